// plano track: follows a planar region through an image sequence, forwards and backwards from
// a reference frame, one engine Track per frame pair.
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <filesystem>

#include "commands.hpp"
#include "files.hpp"
#include "sequence.hpp"

namespace plano_tool {

namespace {

// Coarse-search and optimiser settings the command line does not expose: values that suit
// plates converted to grey levels in 0..1.
constexpr double kSmoothingSigma = 1.0;
constexpr uint32_t kCorrelationSize = 32;
constexpr double kRotationStep = 1.0;
constexpr double kMinOverlap = 0.5;
constexpr double kMinCorrScore = 0.2;
constexpr uint32_t kMinPixelCount = 16;
constexpr uint32_t kSmoothingPasses = 1;
constexpr uint32_t kBlockSize = 8;
constexpr double kIntensitySigma = 0.02;
constexpr double kOutlierCutoff = 9.0;
constexpr double kLambda = 0.001, kLambdaFactor = 10.0;

struct TrackDeleter {
    void operator()(Track *track) const noexcept { vTrackFree(track); }
};

Plx_Matrix33 identity()
{
    Plx_Matrix33 I;
    plx_mat33_ident_s(&I);
    return I;
}

// A search reaching past the plate finds nothing there but costs memory and time with the
// square of the range: along each axis the range is cut to the farthest plate edge from the
// region.
uint32_t clipped_search_range(uint32_t range, const Quad &quad, double Point::*axis, int32_t size)
{
    double lo = INFINITY, hi = -INFINITY;
    for (const Point &p : quad) {
        lo = std::min(lo, p.*axis);
        hi = std::max(hi, p.*axis);
    }
    lo = std::clamp(lo, 0.0, double(size));
    hi = std::clamp(hi, 0.0, double(size));
    double reach = std::ceil(std::max(lo, size - hi)) + 1;
    return static_cast<uint32_t>(std::min(double(range), reach));
}

// One frame pair: the region of the reference frame, at H_previous in the previous frame,
// searched for in the current frame.
FrameResult track_pair(const TrackJob &job, const Plx_Image &reference, const Plx_Image &previous,
                       const Plx_Image &current, const Plx_Image &reference_mask, const Plx_Matrix33 &H_previous,
                       double intensity[2], int frame, const ThreadHostInterface *host)
{
    const TrackSettings &s = job.settings;
    FrameResult out;
    out.frame = frame;
    out.homography = H_previous;
    out.corners = map_through(H_previous, job.reference_quad);
    out.rms_residual = INFINITY;
    ImagePtr previous_mask = fill_quad(out.corners, previous.width, previous.height);
    if (plx_image_bit_count(previous_mask.get()) < kMinPixelCount) {
        out.status = TRACK_REGION_OUT_OF_VIEW;
        return out;
    }
    Plx_Camera camera;
    check(plx_camera_build_linear(&camera, 1.0, 1.0, 1.0, 0.0, 0.0), "camera");
    const uint32_t range_x = clipped_search_range(s.search_range, out.corners, &Point::x, previous.width);
    const uint32_t range_y = clipped_search_range(s.search_range, out.corners, &Point::y, previous.height);
    std::unique_ptr<Track, TrackDeleter> track(
        pTrackNew(const_cast<Plx_Image *>(&previous), &camera, const_cast<Plx_Image *>(&current), &camera,
                  s.levels, nullptr));
    if (!track) throw ToolError("frame " + std::to_string(frame) + ": " + library_reason());
    // The reference image is the previous one itself for the frame next to the reference.
    Plx_Image *reference_image = &reference == &previous ? const_cast<Plx_Image *>(&previous)
                                                         : const_cast<Plx_Image *>(&reference);
    TrackRegion *region = pTrackRegion(
        track.get(), previous_mask.get(), reference_image, &camera, const_cast<Plx_Image *>(&reference_mask),
        nullptr, &H_previous, nullptr, intensity, kSmoothingSigma, kCorrelationSize,
        s.rotation_range_deg * M_PI / 180.0, s.scale_range, kRotationStep, range_y, range_x,
        s.model, kMinOverlap, 0.0, kMinCorrScore, kMinPixelCount, 0.0, kSmoothingPasses, 0.0, 1, 0.0,
        kBlockSize, kIntensitySigma, 0.0, kOutlierCutoff, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
        nullptr, nullptr, nullptr, host);
    if (region == nullptr) throw ToolError("frame " + std::to_string(frame) + ": " + library_reason());
    if (!bTrackOptimise(track.get(), s.iterations, kLambda, kLambdaFactor, host))
        throw ToolError("frame " + std::to_string(frame) + ": " + library_reason());
    out.status = region->status;
    if (out.status != TRACK_REGION_OK) return out;
    bTrackMotionRead(region, &out.homography);
    // The engine scales a projective H to unit norm; files carry it with H22 = 1 as people expect.
    out.homography = with_unit_h22(out.homography);
    out.corners = map_through(out.homography, job.reference_quad);
    out.rms_residual = region->rms_residual;
    if (const Plx_SquMatrix *info = psmTrackInfmatRead(region)) {
        out.information.assign(info->size, std::vector<double>(info->size));
        for (uint32_t i = 0; i < info->size; ++i)
            for (uint32_t k = 0; k < info->size; ++k) out.information[i][k] = plx_squmat_get(info, i, k);
    }
    if (s.illumination) bTrackIntensityModelRead(region, intensity);
    return out;
}

struct TrackOptions {
    std::string sequence, frames, quad, mask, init_from, output = "track.json", csv, script,
        node = "MatchMove1", model = "perspective", illumination = "on", on_lost = "stop";
    int reference = INT32_MIN;
    uint32_t levels = 3, search_range = 16, threads = 0;
    double rotation_range = 0, scale_range = 0;
    int32_t iterations = 10;
    bool quiet = false;
};

// Grey float frames, read on demand; the reference and the last two frames stay in memory.
class FrameCache {
public:
    FrameCache(const FramePattern &pattern, int reference) : pattern_(pattern), reference_(reference) {}
    std::shared_ptr<const Plx_Image> get(int frame)
    {
        auto found = frames_.find(frame);
        if (found != frames_.end()) return found->second;
        ImagePtr image = read_image(pattern_.path(frame));
        std::shared_ptr<const Plx_Image> grey(convert_image(*image, PLX_FORMAT_GREY, PLX_TYPE_FLOAT).release(),
                                              [](const Plx_Image *p) { plx_image_free(const_cast<Plx_Image *>(p)); });
        if (width_ == 0) {
            width_ = grey->width;
            height_ = grey->height;
        } else if (grey->width != width_ || grey->height != height_) {
            throw ToolError("'" + pattern_.path(frame) + "' is " + std::to_string(grey->width) + "x" +
                            std::to_string(grey->height) + ", not " + std::to_string(width_) + "x" +
                            std::to_string(height_) + " like the other frames");
        }
        recent_.push_back(frame);
        if (recent_.size() > 2) {
            if (recent_.front() != reference_) frames_.erase(recent_.front());
            recent_.erase(recent_.begin());
        }
        frames_[frame] = grey;
        return grey;
    }

private:
    const FramePattern &pattern_;
    int reference_;
    int32_t width_ = 0, height_ = 0;
    std::map<int, std::shared_ptr<const Plx_Image>> frames_;
    std::vector<int> recent_;
};

int run_track(const TrackOptions &o)
{
    FramePattern pattern(o.sequence);
    FrameRange range = resolve_frame_range(pattern, o.frames);
    TrackJob job;
    job.first = range.first;
    job.last = range.last;
    job.reference = o.reference == INT32_MIN ? range.first : o.reference;
    if (job.reference < range.first || job.reference > range.last)
        throw ToolError("reference frame " + std::to_string(job.reference) + " is outside frames " +
                        std::to_string(range.first) + "-" + std::to_string(range.last));
    TrackSettings &s = job.settings;
    s.model = model_from_name(o.model);
    s.levels = o.levels;
    s.search_range = o.search_range;
    s.rotation_range_deg = o.rotation_range;
    s.scale_range = o.scale_range;
    s.iterations = o.iterations;
    s.illumination = o.illumination == "on";
    s.continue_when_lost = o.on_lost == "continue";
    if (s.levels < 1 || s.levels > 8) throw ToolError("levels must be 1 to 8");
    if (!(o.rotation_range >= 0 && o.rotation_range <= 180)) throw ToolError("rotation range must be 0 to 180 degrees");
    if (!(o.scale_range >= 0 && o.scale_range < 1)) throw ToolError("scale range must be 0 to below 1");
    if (o.iterations < 1 || o.iterations > 1000) throw ToolError("iterations must be 1 to 1000");
    int given = !o.quad.empty() + !o.mask.empty() + !o.init_from.empty();
    if (given != 1) throw ToolError("give the region as one of --quad, --mask or --init-from");

    // Nothing is read or written before every output is known to be safe to write.
    PathCheck paths;
    for (int frame = range.first; frame <= range.last; ++frame) paths.input(pattern.path(frame));
    if (!o.mask.empty()) paths.input(o.mask);
    if (!o.init_from.empty()) paths.input(o.init_from);
    paths.output(o.output, "--output");
    if (!o.csv.empty()) paths.output(o.csv, "--csv");
    if (!o.script.empty()) paths.output(o.script, "--script");
    paths.check();

    FrameCache cache(pattern, job.reference);
    std::shared_ptr<const Plx_Image> reference = cache.get(job.reference);
    if (!o.quad.empty()) {
        job.reference_quad = parse_quad(o.quad);
    } else if (!o.mask.empty()) {
        ImagePtr mask_image = read_image(o.mask);
        if (mask_image->width != reference->width || mask_image->height != reference->height)
            throw ToolError("mask '" + o.mask + "' is not the size of the plates");
        ImagePtr bits = convert_image(*mask_image, PLX_FORMAT_GREY, PLX_TYPE_BIT);
        job.reference_quad = quad_of_mask(*bits);
    } else {
        job.known = read_script(o.init_from, reference->width, reference->height);
        auto at = job.known.find(job.reference);
        if (at == job.known.end())
            throw ToolError("'" + o.init_from + "' has no key at the reference frame " + std::to_string(job.reference));
        job.reference_quad = at->second;
    }
    check_quad(job.reference_quad, reference->width, reference->height);

    HostPtr host = make_host(o.threads);
    ProgressBar progress("track", range.count(), !o.quiet);
    plano_host_set_progress_callback(host.get(), forward_progress, &progress);
    TrackResult result;
    result.sequence = o.sequence;
    result.width = reference->width;
    result.height = reference->height;
    std::string failure;
    try {
        run_tracking(job, [&](int frame) { return cache.get(frame); }, plano_host_interface(host.get()), progress,
                     result);
    } catch (const ToolError &e) {
        // Keep what was tracked: the files below are written before the failure is reported.
        result.complete = false;
        result.stopped = e.what();
        failure = e.what();
    }
    plano_host_set_progress_callback(host.get(), nullptr, nullptr);
    double fps = progress.finish();

    // A run that stopped early never replaces an earlier file: its result goes beside it.
    auto destination = [&](const std::string &path) {
        std::error_code ec;
        return result.complete || !std::filesystem::exists(path, ec) ? path : partial_path(path);
    };
    const std::string json_path = destination(o.output);
    if (!result.frames.empty()) {
        write_json(json_path, result);
        if (!o.csv.empty()) write_csv(destination(o.csv), result);
        if (!o.script.empty()) write_script(destination(o.script), result, o.node);
    }
    int lost = 0, unreadable = 0;
    for (const FrameResult &f : result.frames) {
        unreadable += f.status == kStatusUnreadable;
        lost += f.status != TRACK_REGION_OK && f.status != kStatusUnreadable;
    }
    std::string written = std::to_string(result.frames.size()) + " frames written to " + json_path;
    if (json_path != o.output) written += " ('" + o.output + "' kept)";
    if (!failure.empty()) throw ToolError(failure + (result.frames.empty() ? "" : "; " + written));
    if (!result.complete && result.stopped == "interrupted")
        throw ToolError("interrupted; " + written, kExitInterrupted);
    if (!result.complete) throw ToolError("region " + result.stopped + "; " + written, kExitLost);
    auto count = [](int n, const char *what) {
        return n ? ", " + std::to_string(n) + (n == 1 ? " frame " : " frames ") + what : std::string();
    };
    if (!o.quiet)
        std::fprintf(stderr, "plano track: %s (%.2f fps)%s%s\n", written.c_str(), fps, count(lost, "lost").c_str(),
                     count(unreadable, "unreadable").c_str());
    return 0;
}

// Forwards from the reference frame to the last, then backwards to the first; `done`
// receives every frame pair's result. Returns early (result.complete false) when stopped.
void track_both_ways(const TrackJob &job, const FrameLoader &frames, const ThreadHostInterface *host,
                     ProgressBar &progress, TrackResult &result,
                     const std::shared_ptr<const Plx_Image> &reference, const Plx_Image &reference_mask,
                     std::vector<FrameResult> &done)
{
    for (int step : {+1, -1}) {
        Plx_Matrix33 H = identity();
        double intensity[2] = {1.0, 0.0};
        std::shared_ptr<const Plx_Image> previous = reference;
        for (int frame = job.reference + step; frame >= job.first && frame <= job.last; frame += step) {
            if (interrupted()) {
                result.complete = false;
                result.stopped = "interrupted";
                return;
            }
            std::shared_ptr<const Plx_Image> current;
            try {
                current = frames(frame);
            } catch (const ToolError &e) {
                // Told to go on, an unreadable frame is marked, and the next one is searched
                // from the last frame that was tracked.
                if (!job.settings.continue_when_lost) throw;
                FrameResult f;
                f.frame = frame;
                f.status = kStatusUnreadable;
                f.reason = e.what();
                f.homography = H;
                f.corners = map_through(H, job.reference_quad);
                f.rms_residual = INFINITY;
                done.push_back(f);
                progress.frame_done();
                continue;
            }
            FrameResult f = track_pair(job, *reference, *previous, *current, reference_mask, H, intensity, frame, host);
            // An interrupt inside the engine leaves this frame half done: it is not kept.
            if (interrupted()) {
                result.complete = false;
                result.stopped = "interrupted";
                return;
            }
            done.push_back(f);
            progress.frame_done();
            if (f.status == TRACK_REGION_OK) {
                H = f.homography;
                previous = current;
            } else if (!job.settings.continue_when_lost) {
                result.complete = false;
                result.stopped = "lost at frame " + std::to_string(frame) + " (" + status_name(f.status) + ")";
                return;
            } else if (auto known = job.known.find(frame); known != job.known.end()) {
                // An earlier track of this frame restarts the search from the right place.
                H = homography_between(job.reference_quad, known->second);
                previous = current;
            }
            // Otherwise the next frame is searched from the last frame that was tracked.
        }
    }
}

}  // namespace

void run_tracking(const TrackJob &job, const FrameLoader &frames, const ThreadHostInterface *host,
                  ProgressBar &progress, TrackResult &result)
{
    result.reference_frame = job.reference;
    result.model = model_name(job.settings.model);
    result.reference_quad = job.reference_quad;
    std::shared_ptr<const Plx_Image> reference = frames(job.reference);
    ImagePtr reference_mask = fill_quad(job.reference_quad, reference->width, reference->height);
    FrameResult start;
    start.frame = job.reference;
    start.homography = identity();
    start.corners = job.reference_quad;
    start.rms_residual = 0;
    std::vector<FrameResult> done{start};
    progress.frame_done();
    auto finish = [&] {
        std::sort(done.begin(), done.end(), [](const FrameResult &a, const FrameResult &b) { return a.frame < b.frame; });
        result.frames = done;
    };
    try {
        track_both_ways(job, frames, host, progress, result, reference, *reference_mask, done);
    } catch (...) {
        // The frames done so far go back with the failure, for the caller to write.
        finish();
        throw;
    }
    finish();
}

void add_track_command(CLI::App &app, int &exit_code)
{
    auto o = std::make_shared<TrackOptions>();
    CLI::App *cmd = app.add_subcommand("track", "Track a planar region through an image sequence");
    cmd->add_option("-s,--sequence", o->sequence, "Plate frame pattern (plate.%04d.exr or plate.####.exr)")
        ->required();
    cmd->add_option("-f,--frames", o->frames, "Frame range FIRST-LAST (default: every frame on disk)");
    cmd->add_option("-r,--reference", o->reference, "Frame the region is drawn on (default: the first)");
    cmd->add_option("--quad", o->quad, "Region corners on the reference frame: x1,y1,x2,y2,x3,y3,x4,y4");
    cmd->add_option("--mask", o->mask, "Region as a mask image (its set pixels' bounding box)");
    cmd->add_option("--init-from", o->init_from, "Start from a four-corner match-move script");
    cmd->add_option("-m,--model", o->model,
                    "Motion model: translation, translation-scale, translation-rotation-scale, affine, "
                    "perspective (default)");
    cmd->add_option("--levels", o->levels, "Image pyramid levels (default 3)");
    cmd->add_option("--search-range", o->search_range, "Pixels searched around the region (default 16)");
    cmd->add_option("--rotation-range", o->rotation_range, "Rotation searched, +- degrees (default 0)");
    cmd->add_option("--scale-range", o->scale_range, "Scale searched, +- fraction (default 0, e.g. 0.1)");
    cmd->add_option("--iterations", o->iterations, "Optimiser iterations per level (default 10)");
    cmd->add_option("--illumination", o->illumination, "Carry brightness changes from frame to frame: on, off")
        ->check(CLI::IsMember({"on", "off"}));
    cmd->add_option("--on-lost", o->on_lost, "When the region is lost: stop (default) or continue")
        ->check(CLI::IsMember({"stop", "continue"}));
    cmd->add_option("-j,--threads", o->threads, "Threads (default: one per core)");
    cmd->add_option("-o,--output", o->output, "JSON result (default track.json)");
    cmd->add_option("--csv", o->csv, "Also write a CSV table");
    cmd->add_option("--script", o->script, "Also write a four-corner match-move script");
    cmd->add_option("--node", o->node, "Node name in the script (default MatchMove1)");
    cmd->add_flag("-q,--quiet", o->quiet, "No progress or summary");
    cmd->callback([o, &exit_code] { exit_code = run_track(*o); });
}

}  // namespace plano_tool
