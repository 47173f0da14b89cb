// plano demo: a short sequence made from a photograph under a known camera move, tracked,
// with an image inserted on the tracked plane, and the accuracy against the known move.
#include <chrono>
#include <cmath>
#include <cstdio>
#include <filesystem>

#include "commands.hpp"
#include "render.hpp"
#include "sequence.hpp"

namespace plano_tool {

namespace {

constexpr int32_t kPlateWidth = 400, kPlateHeight = 260;
// The tracker should follow the synthetic move to well under a pixel.
constexpr double kExpectedAccuracy = 1.0;

struct DemoOptions {
    std::string output = "plano-demo", data_dir = PLANO_DATA_DIR;
    int frames = 24;
    uint32_t threads = 0;
    bool quiet = false;
};

// Plate positions of frame f to photograph positions: the virtual camera pans, turns, moves
// in and tilts a little over the shot.
Plx_Matrix33 camera_move(int f, int frames, int32_t photo_width, int32_t photo_height)
{
    double t = frames > 1 ? static_cast<double>(f) / (frames - 1) : 0.0;
    double angle = (3.0 * std::sin(2.0 * t) - 1.0) * M_PI / 180.0;
    double scale = 1.0 - 0.08 * t;
    double tx = -20 + 40 * t, ty = 10 * std::sin(3.0 * t);
    double g = 2e-5 * t;  // perspective
    Plx_Matrix33 to_centre = {{{1, 0, -kPlateWidth / 2.0}, {0, 1, -kPlateHeight / 2.0}, {0, 0, 1}}};
    Plx_Matrix33 tilt = {{{1, 0, 0}, {0, 1, 0}, {g, 0, 1}}};
    double c = scale * std::cos(angle), s = scale * std::sin(angle);
    Plx_Matrix33 similarity = {{{c, -s, photo_width / 2.0 + tx}, {s, c, photo_height / 2.0 + ty}, {0, 0, 1}}};
    return multiply(similarity, multiply(tilt, to_centre));
}

// A test card to insert: coloured quarters, a grid, and a bar along its top edge.
ImagePtr test_card()
{
    const int32_t size = 256;
    ImagePtr card = make_image(PLX_FORMAT_RGBA, PLX_TYPE_FLOAT, size, size);
    for (int32_t r = 0; r < size; ++r) {
        float *p = static_cast<float *>(plx_image_row(card.get(), r));
        for (int32_t c = 0; c < size; ++c, p += 4) {
            bool right = c >= size / 2, bottom = r >= size / 2;
            float base[3] = {right ? 0.9f : 0.15f, bottom ? 0.8f : 0.25f, (right != bottom) ? 0.2f : 0.85f};
            bool grid = (r % 32) < 3 || (c % 32) < 3;
            bool bar = r < 24;
            for (int k = 0; k < 3; ++k) p[k] = bar ? 1.0f : grid ? 0.05f : base[k];
            p[3] = 1.0f;
        }
    }
    return card;
}

std::string seconds_text(double s)
{
    char buffer[32];
    std::snprintf(buffer, sizeof buffer, "%.2f s", s);
    return buffer;
}

int run_demo(const DemoOptions &o)
{
    using clock = std::chrono::steady_clock;
    if (o.frames < 2 || o.frames > 1000) throw ToolError("frames must be 2 to 1000");
    std::filesystem::path out_dir = std::filesystem::absolute(o.output);
    std::string photo_path = (std::filesystem::path(o.data_dir) / "coffee.png").string();
    ImagePtr photo = read_image(photo_path);
    HostPtr host = make_host(o.threads);
    const ThreadHostInterface *table = plano_host_interface(host.get());

    // 1. The shot: the photograph seen through the moving camera.
    FramePattern plates((out_dir / "plates" / "frame.%04d.png").string());
    std::vector<std::shared_ptr<const Plx_Image>> grey(o.frames);
    std::vector<ImagePtr> colour;
    std::vector<Plx_Matrix33> move(o.frames);
    {
        ProgressBar progress("shot   ", o.frames, !o.quiet);
        for (int f = 0; f < o.frames; ++f) {
            if (interrupted()) throw ToolError("interrupted", kExitInterrupted);
            move[f] = camera_move(f, o.frames, photo->width, photo->height);
            ImagePtr plate = make_image(photo->format, photo->type, kPlateHeight, kPlateWidth);
            check(plx_image_fill_zero(plate.get()), "plate");
            check(bImageProjectiveWarpThreaded(plate.get(), nullptr, nullptr, photo.get(), nullptr, nullptr, &move[f],
                                               nullptr, plate.get(), nullptr, table, nullptr, 0),
                  "making the shot");
            write_image(plates.path(f + 1), *plate);
            grey[f].reset(convert_image(*plate, PLX_FORMAT_GREY, PLX_TYPE_FLOAT).release(),
                          [](const Plx_Image *p) { plx_image_free(const_cast<Plx_Image *>(p)); });
            colour.push_back(std::move(plate));
            progress.frame_done();
        }
    }

    // 2. Tracking from frame 1, where the region is the middle of the plate.
    TrackJob job;
    job.first = 1;
    job.last = o.frames;
    job.reference = 1;
    job.reference_quad = Quad{Point{120, 60}, Point{280, 60}, Point{280, 200}, Point{120, 200}};
    job.settings.model = TRACK_MODEL_PROJ;
    job.settings.search_range = 24;
    TrackResult result;
    result.sequence = plates.text();
    result.width = kPlateWidth;
    result.height = kPlateHeight;
    auto t0 = clock::now();
    double track_fps = 0;
    {
        ProgressBar progress("track  ", o.frames, !o.quiet);
        plano_host_set_progress_callback(host.get(), forward_progress, &progress);
        run_tracking(job, [&](int frame) { return grey[frame - 1]; }, table, progress, result);
        plano_host_set_progress_callback(host.get(), nullptr, nullptr);
        track_fps = progress.finish();
        if (!result.complete && result.stopped == "interrupted") throw ToolError("interrupted", kExitInterrupted);
    }
    double track_seconds = std::chrono::duration<double>(clock::now() - t0).count();

    // 3. The known answer: frame-1 positions to frame-f positions.
    Plx_Matrix33 to_photo_1 = move[0];
    double error_sum = 0, error_max = 0;
    int error_count = 0;
    for (int f = 1; f <= o.frames; ++f) {
        Plx_Matrix33 truth = multiply(inverse(move[f - 1]), to_photo_1);
        Quad true_corners = map_through(truth, job.reference_quad);
        FrameResult *found = nullptr;
        for (FrameResult &r : result.frames)
            if (r.frame == f) found = &r;
        if (found == nullptr) continue;
        found->true_corners = true_corners;
        if (found->status != TRACK_REGION_OK) continue;
        for (int i = 0; i < 4; ++i) {
            double e = std::hypot(found->corners[i].x - true_corners[i].x, found->corners[i].y - true_corners[i].y);
            error_sum += e;
            error_max = std::max(error_max, e);
            ++error_count;
        }
    }
    write_json((out_dir / "track.json").string(), result);
    write_script((out_dir / "track.shk").string(), result, "DemoCorners");

    // 4. A test card on the tracked plane of every frame.
    // Stored as 8 bits like the file, so `plano insert` with card.png renders the same frames.
    ImagePtr card = convert_image(*test_card(), PLX_FORMAT_RGBA, PLX_TYPE_UCHAR);
    write_image((out_dir / "card.png").string(), *card);
    ImagePtr insert = prepare_insert(*card);
    FramePattern comp((out_dir / "comp" / "frame.%04d.png").string());
    auto t1 = clock::now();
    int inserted = 0;
    {
        ProgressBar progress("insert ", o.frames, !o.quiet);
        for (const FrameResult &f : result.frames) {
            if (interrupted()) throw ToolError("interrupted", kExitInterrupted);
            const Plx_Image &plate = *colour[f.frame - 1];
            if (f.status == TRACK_REGION_OK) {
                write_image(comp.path(f.frame), *insert_onto(plate, *insert, f.corners, 1.5, table));
                ++inserted;
            } else {
                write_image(comp.path(f.frame), plate);
            }
            progress.frame_done();
        }
    }
    double insert_seconds = std::chrono::duration<double>(clock::now() - t1).count();

    int lost = o.frames - static_cast<int>(error_count / 4);
    std::printf("plano demo: %d frames of %dx%d made from %s\n", o.frames, kPlateWidth, kPlateHeight,
                photo_path.c_str());
    std::printf("  tracking: %d frames in %s (%.2f fps), %d lost\n", o.frames, seconds_text(track_seconds).c_str(),
                track_fps, lost);
    std::printf("  accuracy against the known move: corner error mean %.3f px, max %.3f px (expected below %.1f px)\n",
                error_count ? error_sum / error_count : 0.0, error_max, kExpectedAccuracy);
    std::printf("  insertion: %d frames in %s (%.2f fps)\n", inserted, seconds_text(insert_seconds).c_str(),
                insert_seconds > 0 ? inserted / insert_seconds : 0.0);
    std::printf("  output: %s (plates/, comp/, track.json, track.shk, card.png)\n", out_dir.string().c_str());
    if (lost > 0 || error_max > kExpectedAccuracy)
        throw ToolError("tracking fell short of its expected accuracy (see above)");
    return 0;
}

}  // namespace

void add_demo_command(CLI::App &app, int &exit_code)
{
    auto o = std::make_shared<DemoOptions>();
    CLI::App *cmd = app.add_subcommand("demo", "Make, track and composite a short demonstration shot");
    cmd->add_option("-o,--output", o->output, "Folder for the results (default ./plano-demo)");
    cmd->add_option("--data-dir", o->data_dir, "Folder holding coffee.png (default: the project's tests/data)");
    cmd->add_option("-n,--frames", o->frames, "Length of the shot (default 24)");
    cmd->add_option("-j,--threads", o->threads, "Threads (default: one per core)");
    cmd->add_flag("-q,--quiet", o->quiet, "No progress bars");
    cmd->callback([o, &exit_code] { exit_code = run_demo(*o); });
}

}  // namespace plano_tool
