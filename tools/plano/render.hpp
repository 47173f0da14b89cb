// Rendering on plates: an image on a tracked plane, and review overlays of quads.
#ifndef PLANO_TOOL_RENDER_HPP
#define PLANO_TOOL_RENDER_HPP

#include <array>

#include "geometry.hpp"

namespace plano_tool {

// The image to insert, prepared once: RGBA float with premultiplied colour, so that the
// warp's filtering of its edges gives matching colour and coverage.
ImagePtr prepare_insert(const Plx_Image &image);

// The plate with the prepared insert warped onto the quad (its top-left, top-right,
// bottom-right and bottom-left corners onto the quad's corners 1 to 4) and laid over it.
// feather > 0 fades the edge over that many pixels inside the quad. The result has the
// plate's format and type.
ImagePtr insert_onto(const Plx_Image &plate, const Plx_Image &insert, const Quad &quad, double feather,
                     const ThreadHostInterface *host);

// The plate (as RGB or RGBA in its own pixel type) with the quad's edges drawn thickness
// pixels wide and its first corner marked, in colour (0..1 per channel).
ImagePtr overlay_quad(const Plx_Image &plate, const Quad &quad, std::array<float, 3> colour,
                      double thickness);

}  // namespace plano_tool

#endif
