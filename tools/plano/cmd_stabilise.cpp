// plano stabilise: turns a track's homographies into stabilising ones and re-renders the plates
// through them, optionally cropped to the area every frame covers.
#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <nlohmann/json.hpp>

#include "commands.hpp"
#include "files.hpp"
#include "plano/stabilise.h"
#include "plates.hpp"
#include "sequence.hpp"

namespace plano_tool {

namespace {

struct StabiliseOptions {
    std::string track, sequence, output, json, frames, anchors, components = "all", crop = "none";
    int every = 0;
    int smooth = 0;  // 0: full stabilisation; N: N smoothing passes
    uint32_t threads = 0;
    bool quiet = false;
};

// The components as users name them, and the engine's flags each sets: x translation,
// y translation, rotation, scale, shear, aspect, perspective x, perspective y.
struct ComponentName {
    const char *name;
    std::array<int32_t, 8> flags;
};
const ComponentName kComponents[] = {
    {"translation", {1, 1, 0, 0, 0, 0, 0, 0}}, {"x-translation", {1, 0, 0, 0, 0, 0, 0, 0}},
    {"y-translation", {0, 1, 0, 0, 0, 0, 0, 0}}, {"rotation", {0, 0, 1, 0, 0, 0, 0, 0}},
    {"scale", {0, 0, 0, 1, 0, 0, 0, 0}},         {"shear", {0, 0, 0, 0, 1, 0, 0, 0}},
    {"aspect", {0, 0, 0, 0, 0, 1, 0, 0}},        {"perspective", {0, 0, 0, 0, 0, 0, 1, 1}},
    {"all", {1, 1, 1, 1, 1, 1, 1, 1}},
};

std::array<int32_t, 8> component_flags(const std::string &text)
{
    std::array<int32_t, 8> flags{};
    size_t begin = 0;
    while (begin <= text.size()) {
        size_t end = std::min(text.find(',', begin), text.size());
        const std::string word = text.substr(begin, end - begin);
        const ComponentName *found = nullptr;
        for (const ComponentName &c : kComponents)
            if (word == c.name) found = &c;
        if (found == nullptr)
            throw ToolError("unknown component '" + word +
                            "' (translation, x-translation, y-translation, rotation, scale, shear, aspect, "
                            "perspective, all)");
        for (int i = 0; i < 8; ++i) flags[i] |= found->flags[i];
        begin = end + 1;
    }
    return flags;
}

Plx_Matrix33 affine(double s, double tx, double ty) { return {{{s, 0, tx}, {0, s, ty}, {0, 0, 1}}}; }

// The anchor flags, one per frame of the track: the listed frames, every n-th frame (and the
// last), or by default the track's reference frame.
std::vector<uint32_t> anchor_flags(const StabiliseOptions &o, const TrackResult &track)
{
    const int first = track.frames.front().frame, last = track.frames.back().frame;
    const size_t n = track.frames.size();
    std::vector<uint32_t> flags(n, 0);
    if (!o.anchors.empty() && o.every > 0) throw ToolError("give --anchors or --every, not both");
    if (!o.anchors.empty()) {
        if (first < 0) throw ToolError("--anchors needs frame numbers from 0 up");
        if (abParseStringOfFrames(uint32_t(first), uint32_t(last), o.anchors.c_str(), flags.data()) == nullptr)
            throw ToolError("anchors '" + o.anchors + "' are not frames " + std::to_string(first) + "-" +
                            std::to_string(last) + " separated by commas: " + library_reason());
    } else if (o.every > 0) {
        for (size_t i = 0; i < n; i += size_t(o.every)) flags[i] = 1;
        flags[n - 1] = 1;
    } else {
        const int reference = std::clamp(track.reference_frame, first, last);
        flags[size_t(reference - first)] = 1;
    }
    return flags;
}

// The crop of the area every stabilised frame covers: the map from stabilised positions to
// output positions, and the output size.
struct Framing {
    Plx_Matrix33 to_output = affine(1, 0, 0);
    int32_t width = 0, height = 0;
    std::array<uint32_t, 4> box{};
};

Framing frame_output(const std::string &mode, const std::vector<Plx_Matrix33> &to_stable, int32_t width,
                     int32_t height)
{
    Framing f;
    f.width = width;
    f.height = height;
    f.box = {0, 0, uint32_t(width), uint32_t(height)};
    if (mode == "none") return f;
    ImagePtr covered;
    for (const Plx_Matrix33 &F : to_stable) {
        ImagePtr frame = fill_quad(map_through(F, image_corners(width, height)), width, height);
        if (!covered) covered = std::move(frame);
        else check(plx_image_bit_and_q(covered.get(), frame.get(), covered.get()), "coverage");
    }
    uint32_t box[4];
    check(bComputeInnerBox(covered.get(), box), "inner box");
    if (box[2] == 0 || box[3] == 0)
        throw ToolError("no area is covered by every stabilised frame; stabilise fewer components, add anchors "
                        "or smooth instead (--smooth)");
    std::copy(box, box + 4, f.box.begin());
    if (mode == "crop") {
        f.width = int32_t(box[2]);
        f.height = int32_t(box[3]);
        f.to_output = affine(1, -double(box[0]), -double(box[1]));
        return f;
    }
    // Scale-up: the largest part of the box in the plate's proportion, centred, fills the frame.
    const double s = std::min(double(box[2]) / width, double(box[3]) / height);
    const double x = box[0] + (box[2] - s * width) / 2, y = box[1] + (box[3] - s * height) / 2;
    f.to_output = affine(1 / s, -x / s, -y / s);
    return f;
}

int run_stabilise(const StabiliseOptions &o)
{
    TrackResult track = read_json(o.track);
    if (o.output.empty() && o.json.empty())
        throw ToolError("give --output (stabilised plates), --json (the stabilising homographies) or both");
    if (o.smooth < 0 || o.smooth > 100000) throw ToolError("smooth must be 0 (full) to 100000 passes");
    if (o.every < 0) throw ToolError("every must be 1 or more frames");
    const std::array<int32_t, 8> flags = component_flags(o.components);
    if (track.frames.empty()) throw ToolError("'" + o.track + "' has no frames");
    const int first = track.frames.front().frame;
    for (size_t i = 0; i < track.frames.size(); ++i)
        if (track.frames[i].frame != first + int(i))
            throw ToolError("the frames of '" + o.track + "' are not consecutive");

    // Frame i's motion H_i becomes S_i; the plate is re-rendered by S_i H_i^-1.
    const size_t n = track.frames.size();
    std::vector<uint32_t> anchors = anchor_flags(o, track);
    std::vector<Plx_Matrix33> tracked(n), smooth(n), to_stable(n);
    int untracked = 0;
    for (size_t i = 0; i < n; ++i) {
        tracked[i] = track.frames[i].homography;
        untracked += track.frames[i].status != TRACK_REGION_OK;
    }
    check(bSmoothHomographies(anchors.data(), tracked.data(), nullptr, nullptr, uint32_t(n), flags[0], flags[1],
                              flags[2], flags[3], flags[4], flags[5], flags[6], flags[7], o.smooth > 0 ? o.smooth : -1,
                              smooth.data()),
          "stabilisation");
    for (size_t i = 0; i < n; ++i) to_stable[i] = multiply(smooth[i], inverse(tracked[i]));
    const Framing framing = frame_output(o.crop, to_stable, track.width, track.height);

    FramePattern plates(o.sequence.empty() ? track.sequence : o.sequence);
    std::optional<FramePattern> output;
    if (!o.output.empty()) output.emplace(o.output);
    std::vector<const FrameResult *> frames = frames_to_render(track, o.frames);
    PathCheck paths;
    paths.input(o.track);
    for (const FrameResult *f : frames) paths.input(plates.path(f->frame));
    if (output)
        for (const FrameResult *f : frames) paths.output(output->path(f->frame), "--output");
    if (!o.json.empty()) paths.output(o.json, "--json");
    paths.check();

    std::vector<Plx_Matrix33> to_output(n);
    for (size_t i = 0; i < n; ++i) to_output[i] = with_unit_h22(multiply(framing.to_output, to_stable[i]));
    if (!o.json.empty()) {
        using json = nlohmann::ordered_json;
        json j;
        j["track"] = o.track;
        j["width"] = framing.width;
        j["height"] = framing.height;
        j["components"] = o.components;
        j["smooth"] = o.smooth;
        json anchor_frames = json::array();
        for (size_t i = 0; i < n; ++i)
            if (anchors[i]) anchor_frames.push_back(first + int(i));
        j["anchors"] = anchor_frames;
        j["crop"] = o.crop;
        j["box"] = framing.box;
        json list = json::array();
        for (size_t i = 0; i < n; ++i) {
            json jf;
            jf["frame"] = first + int(i);
            jf["stabilise"] = matrix_json(to_output[i]);
            jf["inverse"] = matrix_json(with_unit_h22(inverse(to_output[i])));
            list.push_back(jf);
        }
        j["frames"] = list;
        write_text_atomically(o.json, j.dump(2) + '\n');
    }

    double fps = 0;
    if (output) {
        HostPtr host = make_host(o.threads);
        ProgressBar progress("stabilise", static_cast<int>(frames.size()), !o.quiet);
        plano_host_set_progress_callback(host.get(), forward_progress, &progress);
        fps = render_frames(track, plates, *output, frames, {o.track}, progress,
                            [&](const Plx_Image &plate, const FrameResult &f) -> ImagePtr {
                                ImagePtr out = make_image(plate.format, plate.type, framing.height, framing.width);
                                check(plx_image_fill_zero(out.get()), "output");
                                // The warp maps output positions back to plate positions.
                                const Plx_Matrix33 from_output = inverse(to_output[size_t(f.frame - first)]);
                                ProjectiveWarpParams params;
                                vInitProjectiveWarpParams(&params);
                                params.border_fill = 1;  // no dark seam along the plate's edge
                                check(bImageProjectiveWarpThreaded(out.get(), nullptr, nullptr, &plate, nullptr,
                                                                   nullptr, &from_output, &params, out.get(),
                                                                   nullptr, plano_host_interface(host.get()),
                                                                   nullptr, 0),
                                      "warp");
                                return out;
                            });
        plano_host_set_progress_callback(host.get(), nullptr, nullptr);
    }
    if (!o.quiet) {
        std::string what = output ? std::to_string(frames.size()) + " frames written to " + output->text() : "";
        if (!o.json.empty()) what += (what.empty() ? "" : ", ") + std::string("homographies to ") + o.json;
        std::fprintf(stderr, "plano stabilise: %s", what.c_str());
        if (output) std::fprintf(stderr, " (%.2f fps)", fps);
        if (o.crop != "none")
            std::fprintf(stderr, ", %s %ux%u at %u,%u", o.crop == "crop" ? "cropped to" : "scaled up from",
                         framing.box[2], framing.box[3], framing.box[0], framing.box[1]);
        if (untracked) std::fprintf(stderr, ", %d untracked frames held at their last position", untracked);
        std::fprintf(stderr, "\n");
    }
    return 0;
}

}  // namespace

void add_stabilise_command(CLI::App &app, int &exit_code)
{
    auto o = std::make_shared<StabiliseOptions>();
    CLI::App *cmd = app.add_subcommand("stabilise", "Stabilise the plates on a tracked plane");
    cmd->add_option("-t,--track", o->track, "Tracking result (JSON from plano track)")->required();
    cmd->add_option("-o,--output", o->output, "Stabilised frames (e.g. stab/plate.%04d.exr)");
    cmd->add_option("--json", o->json, "Write the stabilising homography of every frame and its inverse");
    cmd->add_option("-s,--sequence", o->sequence, "Plate frame pattern (default: the one in the track)");
    cmd->add_option("-f,--frames", o->frames, "Frames to render, FIRST-LAST (default: all tracked)");
    cmd->add_option("--anchors", o->anchors, "Frames whose motion is kept, e.g. 1,25,50 (default: the reference)");
    cmd->add_option("--every", o->every, "Anchors every N frames from the first, and the last");
    cmd->add_option("--components", o->components,
                    "Motion to remove: translation, x-translation, y-translation, rotation, scale, shear, aspect, "
                    "perspective or all (default), comma-separated");
    cmd->add_option("--smooth", o->smooth,
                    "Smooth the motion with N passes instead of removing it (default 0: remove it)");
    cmd->add_option("--crop", o->crop, "none (default), crop or scale: to the area every frame covers")
        ->check(CLI::IsMember({"none", "crop", "scale"}));
    cmd->add_option("-j,--threads", o->threads, "Threads (default: one per core)");
    cmd->add_flag("-q,--quiet", o->quiet, "No progress or summary");
    cmd->callback([o, &exit_code] { exit_code = run_stabilise(*o); });
}

}  // namespace plano_tool
