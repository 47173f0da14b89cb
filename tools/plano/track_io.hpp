// Tracking results and their files: JSON (read and written), CSV and match-move scripts.
#ifndef PLANO_TOOL_TRACK_IO_HPP
#define PLANO_TOOL_TRACK_IO_HPP

#include <nlohmann/json.hpp>

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "geometry.hpp"

namespace plano_tool {

// The status of a frame whose plate could not be read (the engine's statuses are below it).
constexpr uint32_t kStatusUnreadable = 100;

struct FrameResult {
    int frame = 0;
    uint32_t status = 0;                    // TrackRegionStatus; 0 is tracked
    Plx_Matrix33 homography{};              // reference frame -> this frame
    Quad corners{};
    double rms_residual = 0;
    std::vector<std::vector<double>> information;  // empty when not known
    std::optional<Quad> true_corners;       // the demo's known answer
    std::string reason;                     // why the frame was not tracked, when known
};

struct TrackResult {
    std::string sequence;                   // frame pattern of the plates
    int32_t width = 0, height = 0;
    int reference_frame = 0;
    std::string model;
    Quad reference_quad{};
    bool complete = true;                   // false when stopped early
    std::string stopped;                    // why, when not complete
    std::vector<FrameResult> frames;        // ascending frame order
};

// Name of a region status ("ok", "lost", "no match", ...).
std::string status_name(uint32_t status);

// A 3x3 matrix as JSON, row by row.
nlohmann::ordered_json matrix_json(const Plx_Matrix33 &H);

// The files are written atomically (see write_atomically).
void write_json(const std::string &path, const TrackResult &result);
TrackResult read_json(const std::string &path);
// One line per frame: frame, status, rms residual, the corners, the homography row by row.
void write_csv(const std::string &path, const TrackResult &result);
// The tracked frames (status 0) as a four-corner match-move script.
void write_script(const std::string &path, const TrackResult &result, const std::string &node_name);
// Corners per frame of a script; the caller's size stands in when it has no dimensions line.
// Refuses what a writer never writes: no keys, frames out of order, twice or beyond the int
// range, corners that are not finite, dimensions below 1.
std::map<int, Quad> read_script(const std::string &path, int32_t width, int32_t height);

}  // namespace plano_tool

#endif
