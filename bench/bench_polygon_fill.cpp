// Polygon fills beside OpenCV in the same run: hard fills of 200- and 2,000-vertex concave
// polygons into 8-bit 1920x1080 and 4096x2160 images against cv::fillPoly, and a feathered
// fill with a 20 px edge width into a 1920x1080 float image against what a user would do
// with OpenCV instead (cv::fillPoly, cv::distanceTransform inside and outside, then a ramp).
// Prints the medians of 5 repetitions and the ratios of our times to OpenCV's.
#include <benchmark/benchmark.h>

#include <cmath>
#include <cstdio>
#include <random>
#include <string>
#include <vector>

#include "plano/plano.h"
#include "plano_host/host.h"

#include "opencv_peer.hpp"
#include "ratio_reporter.hpp"

namespace {

constexpr float kFeatherWidth = 20.0f;

struct Size {
    int width, height;
};
const Size kSizes[] = {{1920, 1080}, {4096, 2160}};

// A star of n vertices with random radii between 25% and 48% of the smaller side: concave
// everywhere, with many crossings per row. Integer vertices, so both sides fill the same
// outline.
std::vector<std::pair<int, int>> concave(int n, Size s)
{
    std::mt19937 rng{uint32_t(n)};
    const double m = std::min(s.width, s.height);
    std::uniform_real_distribution<double> radius(0.25 * m, 0.48 * m);
    std::vector<std::pair<int, int>> v;
    for (int i = 0; i < n; ++i) {
        const double a = 2 * M_PI * i / n, r = radius(rng);
        v.emplace_back(int(s.width / 2 + r * std::cos(a)), int(s.height / 2 + r * std::sin(a)));
    }
    return v;
}

// A roto-like outline: a wobbly circle of 600 points.
std::vector<std::pair<float, float>> roto(Size s)
{
    std::vector<std::pair<float, float>> v;
    for (int i = 0; i < 600; ++i) {
        const double a = 2 * M_PI * i / 600, r = 380 + 60 * std::sin(5 * a) + 25 * std::cos(11 * a);
        v.emplace_back(float(s.width / 2 + 1.3 * r * std::cos(a)), float(s.height / 2 + r * std::sin(a)));
    }
    return v;
}

Polygon2D *polygon_of(const std::vector<std::pair<float, float>> &v, float width)
{
    Polygon2D *p = pPolygon2DNew();
    for (const auto &[x, y] : v) bPolygon2DAddWidePointWithT(p, y, x, width, 0.0f);
    bPolygon2DClose(p);
    return p;
}

std::string label(const char *side, const std::string &name, int jobs)
{
    return std::string(side) + "/" + name + " j" + std::to_string(jobs);
}
std::string hard_name(int vertices, Size s)
{
    return "hard " + std::to_string(vertices) + "v " + std::to_string(s.width) + "x" + std::to_string(s.height);
}

void BM_PlanoHard(benchmark::State &state)
{
    const int n = int(state.range(0));
    const Size s = kSizes[state.range(1)];
    std::vector<std::pair<float, float>> v;
    for (const auto &[x, y] : concave(n, s)) v.emplace_back(float(x), float(y));
    Polygon2D *p = polygon_of(v, 0.0f);
    Plx_Image *image = plx_image_form_gen_gl_uc(nullptr, s.height, s.width);
    plx_image_fill_zero(image);
    const double white = 255;
    for (auto _ : state) {
        if (!bImageFillPolygon(image, p, &white, 0)) {
            state.SkipWithError("fill failed");
            break;
        }
        benchmark::DoNotOptimize(image->data);
    }
    plx_image_free(image);
    vPolygon2DDelete(p);
    state.SetLabel(label("plano", hard_name(n, s), 1));
}

void BM_PlanoFeather(benchmark::State &state)
{
    const Size s = kSizes[0];
    const int jobs = int(state.range(0));
    Polygon2D *p = polygon_of(roto(s), kFeatherWidth);
    Plx_Image *alpha = plx_image_form_gen_gl_f(nullptr, s.height, s.width);
    PlanoHost *host = plano_host_new(uint32_t(jobs));
    for (auto _ : state) {
        if (!bImageFillPolygonAlphaThreaded(alpha, nullptr, p, nullptr, nullptr, plano_host_interface(host))) {
            state.SkipWithError("feathered fill failed");
            break;
        }
        benchmark::DoNotOptimize(alpha->data);
    }
    plano_host_free(host);
    plx_image_free(alpha);
    vPolygon2DDelete(p);
    state.SetLabel(label("plano", "feather 20px 1920x1080", jobs));
}

#ifdef PLANO_HAVE_OPENCV
void BM_OpenCVHard(benchmark::State &state)
{
    const int n = int(state.range(0));
    const Size s = kSizes[state.range(1)];
    std::vector<cv::Point> pts;
    for (const auto &[x, y] : concave(n, s)) pts.emplace_back(x, y);
    cv::Mat image(s.height, s.width, CV_8UC1, cv::Scalar(0));
    cv::setNumThreads(1);
    for (auto _ : state) {
        cv::fillPoly(image, std::vector<std::vector<cv::Point>>{pts}, cv::Scalar(255));
        benchmark::DoNotOptimize(image.data);
    }
    state.SetLabel(label("opencv", hard_name(n, s), 1));
}

// The centred feather with OpenCV: distances to the outline inside and outside, then
// 0.5 + 0.5 (inside - outside) / width clamped into [0, 1].
void BM_OpenCVFeather(benchmark::State &state)
{
    const Size s = kSizes[0];
    const int jobs = int(state.range(0));
    std::vector<cv::Point> pts;
    for (const auto &[x, y] : roto(s)) pts.emplace_back(int(x), int(y));
    cv::Mat mask(s.height, s.width, CV_8UC1), outside, d_in, d_out, alpha;
    cv::setNumThreads(jobs);
    for (auto _ : state) {
        mask.setTo(0);
        cv::fillPoly(mask, std::vector<std::vector<cv::Point>>{pts}, cv::Scalar(255));
        cv::bitwise_not(mask, outside);
        cv::distanceTransform(mask, d_in, cv::DIST_L2, cv::DIST_MASK_3);
        cv::distanceTransform(outside, d_out, cv::DIST_L2, cv::DIST_MASK_3);
        cv::subtract(d_in, d_out, alpha);
        alpha.convertTo(alpha, CV_32F, 0.5 / kFeatherWidth, 0.5);
        cv::threshold(alpha, alpha, 1.0, 1.0, cv::THRESH_TRUNC);
        cv::max(alpha, 0.0, alpha);
        benchmark::DoNotOptimize(alpha.data);
    }
    state.SetLabel(label("opencv", "feather 20px 1920x1080", jobs));
}
#endif

void hard_arguments(benchmark::internal::Benchmark *b)
{
    for (int n : {200, 2000})
        for (int size : {0, 1}) b->Args({n, size});
    b->Unit(benchmark::kMillisecond)->UseRealTime()->Repetitions(5)->ReportAggregatesOnly(true);
}
void feather_arguments(benchmark::internal::Benchmark *b)
{
    for (int jobs : {1, 2}) b->Args({jobs});
    b->Unit(benchmark::kMillisecond)->UseRealTime()->Repetitions(5)->ReportAggregatesOnly(true);
}

BENCHMARK(BM_PlanoHard)->Apply(hard_arguments);
BENCHMARK(BM_PlanoFeather)->Apply(feather_arguments);
#ifdef PLANO_HAVE_OPENCV
BENCHMARK(BM_OpenCVHard)->Apply(hard_arguments);
BENCHMARK(BM_OpenCVFeather)->Apply(feather_arguments);
#endif

}  // namespace

int main(int argc, char **argv)
{
    benchmark::Initialize(&argc, argv);
    RatioReporter reporter("opencv", 28, 3);
    benchmark::RunSpecifiedBenchmarks(&reporter);
    vThreadedWorkerPoolFree();
    benchmark::Shutdown();
    return 0;
}
