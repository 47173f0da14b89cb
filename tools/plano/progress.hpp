// A progress bar with frames per second on stderr (drawn only on a terminal).
#ifndef PLANO_TOOL_PROGRESS_HPP
#define PLANO_TOOL_PROGRESS_HPP

#include <chrono>
#include <mutex>
#include <string>

namespace plano_tool {

class ProgressBar {
public:
    ProgressBar(std::string label, int total, bool enabled);
    ~ProgressBar();
    // A frame is done.
    void frame_done();
    // Progress within the current frame, 0..99 (from the engine, maybe on a worker thread).
    void within_frame(int percentage);
    // Ends the bar's line; returns the frames per second over the whole run.
    double finish();
    int done() const { return done_; }

private:
    void draw();

    std::string label_;
    int total_, done_ = 0, within_ = 0;
    bool enabled_, finished_ = false;
    std::chrono::steady_clock::time_point start_, last_draw_;
    std::mutex mutex_;
};

// Engine progress reports (ThreadProgressFunction-like) forwarded to a bar.
void forward_progress(void *bar, int32_t percentage);

}  // namespace plano_tool

#endif
