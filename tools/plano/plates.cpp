// Plates of a tracked sequence for the rendering commands.
#include "plates.hpp"

#include <climits>

#include "files.hpp"
#include "sequence.hpp"
#include "tool.hpp"

namespace plano_tool {

// The frames of a result to render: all of them, or those in the given range.
std::vector<const FrameResult *> frames_to_render(const TrackResult &result, const std::string &range_text)
{
    FrameRange range{INT32_MIN, INT32_MAX};
    if (!range_text.empty()) range = parse_frame_range(range_text);
    std::vector<const FrameResult *> out;
    for (const FrameResult &f : result.frames)
        if (f.frame >= range.first && f.frame <= range.last) out.push_back(&f);
    if (out.empty()) throw ToolError("no tracked frames to render");
    return out;
}

// Checks the plate against the track.
void check_plate(const Plx_Image &plate, const TrackResult &track, const std::string &plate_path)
{
    if (plate.width != track.width || plate.height != track.height)
        throw ToolError("'" + plate_path + "' is " + std::to_string(plate.width) + "x" +
                        std::to_string(plate.height) + " but the track was made on " +
                        std::to_string(track.width) + "x" + std::to_string(track.height) + " plates");
}

double render_frames(const TrackResult &track, const FramePattern &plates, const FramePattern &output,
                     const std::vector<const FrameResult *> &frames, const std::vector<std::string> &inputs,
                     ProgressBar &progress,
                     const std::function<ImagePtr(const Plx_Image &plate, const FrameResult &frame)> &render)
{
    PathCheck paths;
    for (const std::string &path : inputs) paths.input(path);
    for (const FrameResult *f : frames) {
        paths.input(plates.path(f->frame));
        paths.output(output.path(f->frame), "--output");
    }
    paths.check();
    for (const FrameResult *f : frames) {
        if (interrupted())
            throw ToolError("interrupted; " + std::to_string(progress.done()) + " frames written", kExitInterrupted);
        std::string plate_path = plates.path(f->frame), out_path = output.path(f->frame);
        ImagePtr plate = read_image(plate_path);
        check_plate(*plate, track, plate_path);
        ImagePtr frame = render(*plate, *f);
        write_image(out_path, frame ? *frame : *plate);
        progress.frame_done();
    }
    return progress.finish();
}

}  // namespace plano_tool
