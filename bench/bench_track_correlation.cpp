// The tracker's exhaustive correlation of a 64x64 template over a 200x200 search window
// (8-bit grey, 137x137 offsets) beside OpenCV's matchTemplate with TM_CCORR_NORMED, which
// computes the same normalised score, on the same pixels and one thread each.
#include <benchmark/benchmark.h>

#include <random>

#include "plano/track_correlation.h"
#include "plano_host/host.h"

#include "opencv_peer.hpp"

namespace {

constexpr int kSearch = 200, kTemplate = 64;

Plx_Image *random_grey(int size, unsigned seed)
{
    Plx_Image *im = plx_image_form_gen_gl_uc(nullptr, size, size);
    std::mt19937 gen(seed);
    for (int r = 0; r < size; ++r)
        for (int c = 0; c < size; ++c) static_cast<uint8_t *>(plx_image_row(im, r))[c] = uint8_t(gen() & 255);
    return im;
}

struct Data {
    Plx_Image *search = random_grey(kSearch, 1);
    Plx_Image *tpl = random_grey(kTemplate, 2);
    Plx_Image *mask = nullptr;
    Data()
    {
        mask = plx_image_form_gen_b(nullptr, kSearch, kSearch);
        const double one = 1.0;
        plx_image_fill_const(mask, &one);
        plx_image_fill_zero_window(mask, Plx_Window{0, 0, 40, kSearch});  // a clipped window's edge
    }
};

const Data &data()
{
    static const Data d;
    return d;
}

// range(0): 0 unmasked, 1 with a search mask; range(1): jobs.
void BM_Plano(benchmark::State &state)
{
    const Data &d = data();
    PlanoHost *host = plano_host_new(uint32_t(state.range(1)));
    Plx_Image out{};
    for (auto _ : state) {
        if (pgiTrackImageCorrelate2D_q(plano_host_interface(host), d.tpl, nullptr, d.search,
                                       state.range(0) ? d.mask : nullptr, 0.0, &out, nullptr, 0) == nullptr) {
            state.SkipWithError("correlation failed");
            break;
        }
        benchmark::DoNotOptimize(out.data);
    }
    plx_image_free(&out);
    vThreadedWorkerPoolFree();
    plano_host_free(host);
}
BENCHMARK(BM_Plano)->Args({0, 1})->Args({1, 1})->Args({0, 2})->Unit(benchmark::kMillisecond);

#ifdef PLANO_HAVE_OPENCV
void BM_OpenCV(benchmark::State &state)
{
    const Data &d = data();
    cv::setNumThreads(1);
    const cv::Mat search(kSearch, kSearch, CV_8UC1, d.search->data, size_t(d.search->stride));
    const cv::Mat tpl(kTemplate, kTemplate, CV_8UC1, d.tpl->data, size_t(d.tpl->stride));
    cv::Mat out;
    for (auto _ : state) {
        cv::matchTemplate(search, tpl, out, cv::TM_CCORR_NORMED);
        benchmark::DoNotOptimize(out.data);
    }
}
BENCHMARK(BM_OpenCV)->Unit(benchmark::kMillisecond);
#endif

}  // namespace

BENCHMARK_MAIN();
