// Plates of a tracked sequence for the rendering commands.
#ifndef PLANO_TOOL_PLATES_HPP
#define PLANO_TOOL_PLATES_HPP

#include <functional>
#include <string>
#include <vector>

#include "progress.hpp"
#include "sequence.hpp"
#include "track_io.hpp"

namespace plano_tool {

// The frames of a result to render: all of them, or those in the given range (FIRST-LAST).
std::vector<const FrameResult *> frames_to_render(const TrackResult &result, const std::string &range_text);
// Refuses a plate of another size than the track's.
void check_plate(const Plx_Image &plate, const TrackResult &track, const std::string &plate_path);
// Reads, checks and renders the plate of every frame into the output pattern, a frame at a
// time, honouring Ctrl-C between frames; render returns null to write the plate as it is.
// Before anything is written, refuses an output frame that is a plate or one of the other
// inputs. Returns the frames per second.
double render_frames(const TrackResult &track, const FramePattern &plates, const FramePattern &output,
                     const std::vector<const FrameResult *> &frames, const std::vector<std::string> &inputs,
                     ProgressBar &progress,
                     const std::function<ImagePtr(const Plx_Image &plate, const FrameResult &frame)> &render);

}  // namespace plano_tool

#endif
