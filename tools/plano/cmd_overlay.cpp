// plano overlay: draws the tracked quads over the plates for review.
#include <cstdio>

#include "commands.hpp"
#include "plates.hpp"
#include "render.hpp"
#include "sequence.hpp"

namespace plano_tool {

namespace {

struct OverlayOptions {
    std::string track, sequence, output, frames, colour = "0,1,0", lost_colour = "1,0,0";
    double thickness = 2;
    bool quiet = false;
};

std::array<float, 3> parse_colour(const std::string &text)
{
    std::array<float, 3> c{};
    std::string spaced = text;
    for (char &ch : spaced)
        if (ch == ',') ch = ' ';
    double r, g, b;
    char extra;
    auto unit = [](double v) { return v >= 0 && v <= 1; };  // false for NaN too
    if (std::sscanf(spaced.c_str(), "%lf %lf %lf %c", &r, &g, &b, &extra) != 3 || !unit(r) || !unit(g) || !unit(b))
        throw ToolError("colour '" + text + "' is not three numbers 0..1 (r,g,b)");
    c = {float(r), float(g), float(b)};
    return c;
}

int run_overlay(const OverlayOptions &o)
{
    TrackResult track = read_json(o.track);
    FramePattern plates(o.sequence.empty() ? track.sequence : o.sequence);
    FramePattern output(o.output);
    std::vector<const FrameResult *> frames = frames_to_render(track, o.frames);
    std::array<float, 3> ok = parse_colour(o.colour), lost = parse_colour(o.lost_colour);
    if (!(o.thickness > 0 && o.thickness <= 100)) throw ToolError("thickness must be in (0, 100] pixels");
    HostPtr host = make_host(1);  // for Ctrl-C
    ProgressBar progress("overlay", static_cast<int>(frames.size()), !o.quiet);
    const double fps = render_frames(track, plates, output, frames, {o.track}, progress,
                                     [&](const Plx_Image &plate, const FrameResult &f) {
                                         return overlay_quad(plate, f.corners, f.status == TRACK_REGION_OK ? ok : lost,
                                                             o.thickness);
                                     });
    if (!o.quiet)
        std::fprintf(stderr, "plano overlay: %zu frames written to %s (%.2f fps)\n", frames.size(),
                     output.text().c_str(), fps);
    return 0;
}

}  // namespace

void add_overlay_command(CLI::App &app, int &exit_code)
{
    auto o = std::make_shared<OverlayOptions>();
    CLI::App *cmd = app.add_subcommand("overlay", "Draw the tracked quads over the plates for review");
    cmd->add_option("-t,--track", o->track, "Tracking result (JSON from plano track)")->required();
    cmd->add_option("-o,--output", o->output, "Output frame pattern (e.g. review/frame.%04d.jpg)")->required();
    cmd->add_option("-s,--sequence", o->sequence, "Plate frame pattern (default: the one in the track)");
    cmd->add_option("-f,--frames", o->frames, "Frames to render, FIRST-LAST (default: all tracked)");
    cmd->add_option("--colour", o->colour, "Colour of tracked quads, r,g,b in 0..1 (default 0,1,0)");
    cmd->add_option("--lost-colour", o->lost_colour, "Colour of lost quads (default 1,0,0)");
    cmd->add_option("--thickness", o->thickness, "Line width in pixels (default 2)");
    cmd->add_flag("-q,--quiet", o->quiet, "No progress or summary");
    cmd->callback([o, &exit_code] { exit_code = run_overlay(*o); });
}

}  // namespace plano_tool
