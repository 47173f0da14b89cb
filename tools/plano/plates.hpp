// Plates of a tracked sequence for the rendering commands.
#ifndef PLANO_TOOL_PLATES_HPP
#define PLANO_TOOL_PLATES_HPP

#include <string>
#include <vector>

#include "track_io.hpp"

namespace plano_tool {

// The frames of a result to render: all of them, or those in the given range (FIRST-LAST).
std::vector<const FrameResult *> frames_to_render(const TrackResult &result, const std::string &range_text);
// Refuses a plate of another size than the track's, and an output path that is the plate's.
void check_plate(const Plx_Image &plate, const TrackResult &track, const std::string &plate_path,
                 const std::string &out_path);

}  // namespace plano_tool

#endif
