// plano insert: renders an image onto the tracked plane of every frame.
#include <cstdio>

#include "commands.hpp"
#include "render.hpp"
#include "plates.hpp"
#include "sequence.hpp"

namespace plano_tool {

namespace {

struct InsertOptions {
    std::string track, sequence, image, output, frames;
    double feather = 0;
    uint32_t threads = 0;
    bool quiet = false;
};

int run_insert(const InsertOptions &o)
{
    TrackResult track = read_json(o.track);
    FramePattern plates(o.sequence.empty() ? track.sequence : o.sequence);
    FramePattern output(o.output);
    std::vector<const FrameResult *> frames = frames_to_render(track, o.frames);
    if (!(o.feather >= 0 && o.feather <= 10000)) throw ToolError("feather must be 0 to 10000 pixels");
    ImagePtr insert = prepare_insert(*read_image(o.image));
    HostPtr host = make_host(o.threads);
    ProgressBar progress("insert", static_cast<int>(frames.size()), !o.quiet);
    int untracked = 0;
    const double fps = render_frames(track, plates, output, frames, {o.track, o.image}, progress,
                                     [&](const Plx_Image &plate, const FrameResult &f) -> ImagePtr {
                                         if (f.status == TRACK_REGION_OK)
                                             return insert_onto(plate, *insert, f.corners, o.feather,
                                                                plano_host_interface(host.get()));
                                         // An untracked frame keeps its plate: the output has no holes.
                                         ++untracked;
                                         return nullptr;
                                     });
    if (!o.quiet)
        std::fprintf(stderr, "plano insert: %zu frames written to %s (%.2f fps)%s\n", frames.size(),
                     output.text().c_str(), fps,
                     untracked ? (", " + std::to_string(untracked) + " untracked frames left as plates").c_str()
                               : "");
    return 0;
}

}  // namespace

void add_insert_command(CLI::App &app, int &exit_code)
{
    auto o = std::make_shared<InsertOptions>();
    CLI::App *cmd = app.add_subcommand("insert", "Render an image onto the tracked plane of every frame");
    cmd->add_option("-t,--track", o->track, "Tracking result (JSON from plano track)")->required();
    cmd->add_option("-i,--image", o->image, "Image to insert; its corners go onto the quad's corners 1-4")
        ->required();
    cmd->add_option("-o,--output", o->output, "Output frame pattern (e.g. out/comp.%04d.png)")->required();
    cmd->add_option("-s,--sequence", o->sequence, "Plate frame pattern (default: the one in the track)");
    cmd->add_option("-f,--frames", o->frames, "Frames to render, FIRST-LAST (default: all tracked)");
    cmd->add_option("--feather", o->feather, "Soft edge width inside the quad, in pixels (default 0)");
    cmd->add_option("-j,--threads", o->threads, "Threads (default: one per core)");
    cmd->add_flag("-q,--quiet", o->quiet, "No progress or summary");
    cmd->callback([o, &exit_code] { exit_code = run_insert(*o); });
}

}  // namespace plano_tool
