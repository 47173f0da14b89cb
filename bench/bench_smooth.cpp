// Threaded Gaussian smoothing of a 1920x1080 frame beside OpenCV's GaussianBlur with the same
// kernel size and replicated borders, on the same pixels and the same number of threads.
// After the runs, a table of median times and of our time over OpenCV's.
#include <benchmark/benchmark.h>

#include <cmath>
#include <cstdio>
#include <cstring>
#include <map>
#include <random>
#include <string>

#include "plano_host/host.h"
#include "ratio_reporter.hpp"

#include "opencv_peer.hpp"

namespace {

constexpr int kWidth = 1920, kHeight = 1080;
enum Kind { kFloatGrey = 0, kByteRgb = 1 };

// One source image per kind, made once: a smooth pattern with noise, like a plate.
Plx_Image *source(int kind)
{
    static Plx_Image *images[2] = {nullptr, nullptr};
    if (images[kind] == nullptr) {
        Plx_Image *im = kind == kFloatGrey ? plx_image_form_gen_gl_f(nullptr, kHeight, kWidth)
                                           : plx_image_form_gen_rgb_uc(nullptr, kHeight, kWidth);
        std::mt19937 gen(1);
        std::uniform_real_distribution<float> noise(-0.1f, 0.1f);
        const int channels = kind == kFloatGrey ? 1 : 3;
        for (int y = 0; y < kHeight; ++y)
            for (int x = 0; x < kWidth * channels; ++x) {
                const float v = 0.5f + 0.3f * std::sin(x * 0.01f) * std::cos(y * 0.013f) + noise(gen);
                if (kind == kFloatGrey)
                    static_cast<float *>(plx_image_row(im, y))[x] = v;
                else
                    static_cast<uint8_t *>(plx_image_row(im, y))[x] = uint8_t(std::lround(std::fmin(std::fmax(v, 0.f), 1.f) * 255));
            }
        images[kind] = im;
    }
    return images[kind];
}

std::string label(const char *who, int kind, int sigma, int jobs)
{
    return std::string(who) + (kind == kFloatGrey ? "/float_grey" : "/u8_rgb") + "/sigma" + std::to_string(sigma) +
           "/jobs" + std::to_string(jobs);
}

void BM_Plano(benchmark::State &state)
{
    const int kind = int(state.range(0)), sigma = int(state.range(1)), jobs = int(state.range(2));
    const Plx_Image *src = source(kind);
    PlanoHost *host = plano_host_new(uint32_t(jobs));
    Plx_Image dest{}, mid{};
    for (auto _ : state) {
        if (pgiThreadedSmoothImage(plano_host_interface(host), src, &dest, sigma, &mid) == nullptr) {
            state.SkipWithError("smoothing failed");
            break;
        }
        benchmark::DoNotOptimize(dest.data);
    }
    plx_image_free(&dest);
    plx_image_free(&mid);
    plano_host_free(host);
    state.SetLabel(label("plano", kind, sigma, jobs));
}

#ifdef PLANO_HAVE_OPENCV
void BM_OpenCV(benchmark::State &state)
{
    const int kind = int(state.range(0)), sigma = int(state.range(1)), jobs = int(state.range(2));
    const Plx_Image *src = source(kind);
    const int type = kind == kFloatGrey ? CV_32FC1 : CV_8UC3;
    const cv::Mat in(kHeight, kWidth, type, src->data, std::size_t(src->stride));
    cv::Mat out(kHeight, kWidth, type);
    const int size = 2 * int(std::trunc(4.0 * sigma)) + 1;
    cv::setNumThreads(jobs);
    for (auto _ : state) {
        cv::GaussianBlur(in, out, cv::Size(size, size), sigma, sigma, cv::BORDER_REPLICATE);
        benchmark::DoNotOptimize(out.data);
    }
    state.SetLabel(label("opencv", kind, sigma, jobs));
}
#endif

void arguments(benchmark::internal::Benchmark *b)
{
    for (int kind : {kFloatGrey, kByteRgb})
        for (int sigma : {1, 2, 4})
            for (int jobs : {1, 2}) b->Args({kind, sigma, jobs});
    b->Unit(benchmark::kMillisecond)->UseRealTime()->Repetitions(5)->ReportAggregatesOnly(true);
}

BENCHMARK(BM_Plano)->Apply(arguments);
#ifdef PLANO_HAVE_OPENCV
BENCHMARK(BM_OpenCV)->Apply(arguments);
#endif

}  // namespace

int main(int argc, char **argv)
{
    benchmark::Initialize(&argc, argv);
    RatioReporter reporter("opencv", 26, 2);
    benchmark::RunSpecifiedBenchmarks(&reporter);
    vThreadedWorkerPoolFree();
    benchmark::Shutdown();
    return 0;
}
