// Progress bar.
#include "progress.hpp"

#include <unistd.h>

#include <cstdio>

namespace plano_tool {

ProgressBar::ProgressBar(std::string label, int total, bool enabled)
    : label_(std::move(label)), total_(total > 0 ? total : 1), enabled_(enabled && isatty(2)),
      start_(std::chrono::steady_clock::now()), last_draw_(start_)
{
    if (enabled_) draw();
}

ProgressBar::~ProgressBar() { finish(); }

void ProgressBar::frame_done()
{
    std::lock_guard<std::mutex> lock(mutex_);
    ++done_;
    within_ = 0;
    if (enabled_) draw();
}

void ProgressBar::within_frame(int percentage)
{
    std::lock_guard<std::mutex> lock(mutex_);
    within_ = percentage < 0 ? 0 : percentage > 99 ? 99 : percentage;
    // Redraw at most ten times a second: the engine may report often.
    auto now = std::chrono::steady_clock::now();
    if (enabled_ && now - last_draw_ > std::chrono::milliseconds(100)) draw();
}

double ProgressBar::finish()
{
    std::lock_guard<std::mutex> lock(mutex_);
    double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start_).count();
    if (enabled_ && !finished_) {
        draw();
        std::fputc('\n', stderr);
    }
    finished_ = true;
    return seconds > 0 ? done_ / seconds : 0.0;
}

void ProgressBar::draw()
{
    constexpr int kWidth = 30;
    auto now = std::chrono::steady_clock::now();
    last_draw_ = now;
    double seconds = std::chrono::duration<double>(now - start_).count();
    double fraction = (done_ + within_ / 100.0) / total_;
    if (fraction > 1) fraction = 1;
    int filled = static_cast<int>(fraction * kWidth);
    char bar[kWidth + 1];
    for (int i = 0; i < kWidth; ++i) bar[i] = i < filled ? '#' : '.';
    bar[kWidth] = '\0';
    double fps = seconds > 0 ? done_ / seconds : 0.0;
    std::fprintf(stderr, "\r%s [%s] %d/%d frames  %.2f fps ", label_.c_str(), bar, done_, total_, fps);
    std::fflush(stderr);
}

void forward_progress(void *bar, int32_t percentage)
{
    static_cast<ProgressBar *>(bar)->within_frame(percentage);
}

}  // namespace plano_tool
