// The tool's commands. Each adds its subcommand to the application; running it sets the exit
// code. Failures are thrown as ToolError and reported by main on one line.
#ifndef PLANO_TOOL_COMMANDS_HPP
#define PLANO_TOOL_COMMANDS_HPP

#include <CLI/CLI.hpp>

#include <functional>
#include <map>
#include <memory>

#include "progress.hpp"
#include "track_io.hpp"

namespace plano_tool {

void add_track_command(CLI::App &app, int &exit_code);
void add_insert_command(CLI::App &app, int &exit_code);
void add_overlay_command(CLI::App &app, int &exit_code);
void add_stabilise_command(CLI::App &app, int &exit_code);
void add_demo_command(CLI::App &app, int &exit_code);

// What `plano track` (and the demo) ask of the tracker.
struct TrackSettings {
    uint32_t model = TRACK_MODEL_PROJ;
    uint32_t levels = 3;
    uint32_t search_range = 16;       // pixels around the region
    double rotation_range_deg = 0;    // half-range of the coarse rotation sweep
    double scale_range = 0;           // half-range of the coarse scale sweep (0.1 = 10 %)
    int32_t iterations = 10;
    bool illumination = true;         // carry the gain and offset from frame to frame
    bool continue_when_lost = false;
};

struct TrackJob {
    TrackSettings settings;
    int first = 0, last = 0, reference = 0;
    Quad reference_quad{};
    std::map<int, Quad> known;        // corners from an earlier track, to restart lost frames
};

// A frame of the sequence, as the tracker wants it (grey float).
using FrameLoader = std::function<std::shared_ptr<const Plx_Image>(int frame)>;

// Tracks the quad forwards and backwards from the reference frame, one frame pair at a time.
// Stops early on Ctrl-C (complete false, "interrupted") and, unless told to continue, on a
// lost region (complete false, "lost at frame N: <status>"); result holds every frame done.
// Builds without the engine's tracker throw ToolError.
void run_tracking(const TrackJob &job, const FrameLoader &frames, const ThreadHostInterface *host,
                  ProgressBar &progress, TrackResult &result);

// Motion model from its name ("translation", "translation-scale",
// "translation-rotation-scale", "affine", "perspective").
uint32_t model_from_name(const std::string &name);
std::string model_name(uint32_t model);

}  // namespace plano_tool

#endif
