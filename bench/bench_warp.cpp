// The projective warp beside OpenCV's cv::warpPerspective (bilinear), on the same 1920x1080
// images and homography in the same run: 8-bit RGB and float grey, 1 and 2 host jobs, our
// bilinear path and our fast render. Prints the medians of 5 repetitions and the ratios of
// our times to OpenCV's.
#include <benchmark/benchmark.h>

#include <cmath>
#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include "plano/plano.h"
#include "plano_host/host.h"

#include "opencv_peer.hpp"

namespace {

constexpr int kWidth = 1920, kHeight = 1080;

struct Case {
    const char *name;
    Plx_ImageFormat format;
    Plx_PixelType type;
};
const Case kCases[] = {{"rgb8", PLX_FORMAT_RGB, PLX_TYPE_UCHAR}, {"greyf", PLX_FORMAT_GREY, PLX_TYPE_FLOAT}};

Plx_Image *textured(const Case &c)
{
    Plx_Image *im = plx_image_form_gen(nullptr, c.format, c.type, kHeight, kWidth);
    const int channels = int(plx_image_format_channels(c.format));
    for (int r = 0; r < kHeight; ++r)
        for (int x = 0; x < kWidth; ++x)
            for (int k = 0; k < channels; ++k) {
                const double v = 0.5 + 0.45 * std::sin(0.05 * x + k) * std::cos(0.031 * r - k);
                if (c.type == PLX_TYPE_UCHAR)
                    static_cast<uint8_t *>(plx_image_row(im, r))[x * channels + k] = uint8_t(v * 255.0 + 0.5);
                else
                    static_cast<float *>(plx_image_row(im, r))[x * channels + k] = float(v);
            }
    return im;
}

// Output pixels to source pixels: a 4 degree rotation about the centre, 5% zoom and a
// slight perspective, so most of the output is covered.
Plx_Matrix33 homography()
{
    const double a = 4.0 * M_PI / 180.0, s = 1.0 / 1.05, cx = kWidth / 2.0, cy = kHeight / 2.0;
    const double c = s * std::cos(a), d = s * std::sin(a);
    Plx_Matrix33 H{{{c, -d, cx - c * cx + d * cy}, {d, c, cy - d * cx - c * cy}, {2e-5, 1e-5, 1.0}}};
    return H;
}

std::map<std::string, double> g_medians, g_cpu_medians;

class MedianReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run> &runs) override
    {
        for (const Run &r : runs)
            if (r.run_type == Run::RT_Aggregate && r.aggregate_name == "median")
                g_medians[r.run_name.function_name] = r.GetAdjustedRealTime(),
                g_cpu_medians[r.run_name.function_name] = r.GetAdjustedCPUTime();
        ConsoleReporter::ReportRuns(runs);
    }
};

void plano_warp(benchmark::State &state, Case c, bool fast, uint32_t jobs)
{
    Plx_Image *src = textured(c);
    Plx_Image *out = plx_image_form_gen(nullptr, c.format, c.type, kHeight, kWidth);
    plx_image_fill_zero(out);
    PlanoHost *host = plano_host_new(jobs);
    const Plx_Matrix33 H = homography();
    ProjectiveWarpParams p;
    vInitProjectiveWarpParams(&p);
    p.fast_render = fast ? 1 : 0;
    p.tile_size = 32;
    for (auto _ : state) {
        if (!bImageProjectiveWarpThreaded(out, nullptr, nullptr, src, nullptr, nullptr, &H, &p, out, nullptr,
                                          plano_host_interface(host), nullptr, 0))
            state.SkipWithError("warp failed");
        benchmark::ClobberMemory();
    }
    vThreadedWorkerPoolFree();
    plano_host_free(host);
    plx_image_free(src);
    plx_image_free(out);
}

#ifdef PLANO_HAVE_OPENCV
void opencv_warp(benchmark::State &state, Case c, int jobs)
{
    Plx_Image *src = textured(c);
    const int type = c.type == PLX_TYPE_UCHAR ? CV_8UC3 : CV_32FC1;
    cv::Mat s(kHeight, kWidth, type, src->data, std::size_t(src->stride)), d;
    // OpenCV places pixel centres on integers, we place them on halves: the same map is
    // T(-0.5) H T(0.5).
    const Plx_Matrix33 H = homography();
    cv::Matx33d M(H.m[0][0], H.m[0][1], H.m[0][2], H.m[1][0], H.m[1][1], H.m[1][2], H.m[2][0], H.m[2][1], H.m[2][2]);
    const cv::Matx33d to(1, 0, 0.5, 0, 1, 0.5, 0, 0, 1), from(1, 0, -0.5, 0, 1, -0.5, 0, 0, 1);
    const cv::Matx33d Mcv = from * M * to;
    cv::setNumThreads(jobs);
    for (auto _ : state) {
        cv::warpPerspective(s, d, Mcv, cv::Size(kWidth, kHeight), cv::INTER_LINEAR | cv::WARP_INVERSE_MAP,
                            cv::BORDER_CONSTANT);
        benchmark::DoNotOptimize(d.data);
    }
    plx_image_free(src);
}
#endif

}  // namespace

// Medians of 5 repetitions in milliseconds of wall time (the jobs run on other threads).
void configure(benchmark::internal::Benchmark *b)
{
    b->Repetitions(5)->ReportAggregatesOnly(true)->Unit(benchmark::kMillisecond)->UseRealTime();
}

int main(int argc, char **argv)
{
    for (const Case &c : kCases)
        for (uint32_t jobs : {1u, 2u}) {
            const std::string suffix = "/jobs:" + std::to_string(jobs);
            configure(benchmark::RegisterBenchmark((std::string(c.name) + "/plano_bilinear" + suffix).c_str(),
                                                   plano_warp, c, false, jobs));
            configure(benchmark::RegisterBenchmark((std::string(c.name) + "/plano_fast" + suffix).c_str(), plano_warp,
                                                   c, true, jobs));
#ifdef PLANO_HAVE_OPENCV
            configure(benchmark::RegisterBenchmark((std::string(c.name) + "/opencv" + suffix).c_str(), opencv_warp,
                                                   c, int(jobs)));
#endif
        }
    benchmark::Initialize(&argc, argv);
    MedianReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    // Wall time is what a caller waits; on a loaded machine it also holds time the process
    // was not running, so the calling thread's CPU time is shown beside it (the whole work
    // for one job, since job 0 runs on the calling thread).
    for (int cpu = 0; cpu < 2; ++cpu) {
        const auto &m = cpu ? g_cpu_medians : g_medians;
        std::printf("\nmedian ms (%s)  plano bilinear   plano fast   opencv   bilinear/opencv   fast/opencv\n",
                    cpu ? "calling thread CPU" : "wall");
        for (const Case &c : kCases)
            for (uint32_t jobs : {1u, 2u}) {
                if (cpu && jobs > 1) continue;
                const std::string base = std::string(c.name) + "/", suffix = "/jobs:" + std::to_string(jobs);
                auto at = [&](const std::string &k) { return m.count(k) ? m.at(k) : 0.0; };
                const double bil = at(base + "plano_bilinear" + suffix), fast = at(base + "plano_fast" + suffix);
                const double cv = at(base + "opencv" + suffix);
                std::printf("%-6s jobs %u      %10.2f   %10.2f   %6.2f   %15.2f   %11.2f\n", c.name, jobs, bil, fast,
                            cv, cv > 0 ? bil / cv : 0.0, cv > 0 ? fast / cv : 0.0);
            }
    }
    benchmark::Shutdown();
    return 0;
}
