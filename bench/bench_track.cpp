// One frame of planar tracking (bTrackOptimise with its Track and regions made and freed, as a
// host does per frame) beside OpenCV's findTransformECC (homography, the same 4-level pyramid
// run coarse to fine, the same template and warm start), on the same synthetic frame pairs:
// 1280x720 and 1920x1080, one 300x300 region and four, 1 and 2 threads. After the runs, a
// table of median times and mean corner errors (over the pairs) against the homographies the
// frames were made with.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "plano/plano.h"
#include "plano_host/host.h"

#include "opencv_peer.hpp"

namespace {

constexpr int kRegion = 300;
constexpr int kLevels = 4;
constexpr int kIterations = 20;
// Region settings for precision: no pre-smoothing and no smoothing passes (the finest level
// sees the frames at full resolution, as ECC does), and 32 x 32 pixel blocks (plain
// observations sum the same terms whatever the block size; larger blocks mean fewer of them).
constexpr double kSmoothing = 0.0;
constexpr uint32_t kBlock = 32;

struct M3 {
    double m[3][3];
};

M3 mul(const M3 &a, const M3 &b)
{
    M3 r{};
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j)
            for (int k = 0; k < 3; ++k) r.m[i][j] += a.m[i][k] * b.m[k][j];
    return r;
}

void apply(const M3 &h, double x, double y, double &u, double &v)
{
    const double w = h.m[2][0] * x + h.m[2][1] * y + h.m[2][2];
    u = (h.m[0][0] * x + h.m[0][1] * y + h.m[0][2]) / w;
    v = (h.m[1][0] * x + h.m[1][1] * y + h.m[1][2]) / w;
}

M3 shift(double x, double y) { return M3{{{1, 0, x}, {0, 1, y}, {0, 0, 1}}}; }

Plx_Matrix33 to_plx(const M3 &a)
{
    Plx_Matrix33 p;
    std::memcpy(p.m, a.m, sizeof p.m);
    return p;
}

// Motion k of six (frame 0 to frame 1) about the frame centre: motion 0 shifts by (7, -4)
// pixels, turns 2 degrees, zooms 2 % and adds a little perspective; the others step through
// shifts, turns (down to -2 degrees), zooms (down to -2 %) and perspectives around it.
M3 truth(int w, int h, int k)
{
    const double a = (2.0 - 0.8 * k) * M_PI / 180.0, s = 1.02 - 0.008 * k;
    const double px = 1.5e-5 - 0.6e-5 * k, py = -1e-5 + 0.5e-5 * k;
    const M3 r{{{s * std::cos(a), -s * std::sin(a), 0}, {s * std::sin(a), s * std::cos(a), 0}, {px, py, 1}}};
    return mul(shift(w / 2.0 + 7 - 2.5 * k, h / 2.0 - 4 + 1.5 * k), mul(r, shift(-w / 2.0, -h / 2.0)));
}

// Accuracy is the mean over this many frame pairs (each of the six motions four times, with
// noise of their own): one pair is one noise sample, too few to tell two estimators at their
// noise floor apart.
constexpr int kPairs = 24;

struct Pair {
    Plx_Image *frame[2] = {nullptr, nullptr};
    M3 motion{};
};

// The photograph stretched over the frame with fine detail added, then the second frame as
// the first under motion k mod 6 with gain 1.1 and noise of pair k's own.
Pair make_pair(int w, int h, int k)
{
    Pair p;
    p.motion = truth(w, h, k % 6);
    Plx_Image *photo = nullptr;
    const std::string path = std::string(__FILE__).substr(0, std::string(__FILE__).rfind('/')) +
                             "/../tests/data/coffee_grey.pgm";
    if (FILE *f = std::fopen(path.c_str(), "rb")) {
        int pw = 0, ph = 0, mx = 0;
        if (std::fscanf(f, "P5 %d %d %d", &pw, &ph, &mx) == 3 && std::fgetc(f) != EOF) {
            photo = plx_image_form_gen_gl_uc(nullptr, ph, pw);
            for (int r = 0; r < ph; ++r)
                if (std::fread(plx_image_row(photo, r), 1, std::size_t(pw), f) != std::size_t(pw)) break;
        }
        std::fclose(f);
    }
    if (photo == nullptr) {
        std::fprintf(stderr, "cannot read %s\n", path.c_str());
        std::exit(1);
    }
    Plx_Image *base = plx_image_form_gen_gl_uc(nullptr, h, w);
    const M3 stretch{{{double(photo->width) / w, 0, 0}, {0, double(photo->height) / h, 0}, {0, 0, 1}}};
    Plx_Matrix33 hs = to_plx(stretch);
    bImageProjectiveWarp(base, nullptr, nullptr, photo, nullptr, nullptr, &hs, nullptr, base, nullptr, nullptr, nullptr,
                         0);
    std::mt19937 rng(2);
    std::normal_distribution<double> grain(0.0, 6.0);
    std::mt19937 noise(uint32_t(100 + k));
    for (int r = 0; r < h; ++r) {
        auto *row = static_cast<uint8_t *>(plx_image_row(base, r));
        for (int c = 0; c < w; ++c) {
            const double detail = 10.0 * std::sin(0.7 * c + 0.3 * r) * std::cos(0.5 * r - 0.2 * c) + grain(rng);
            row[c] = uint8_t(std::clamp(std::lround(0.8 * row[c] + 20 + detail), 0L, 255L));
        }
    }
    // Blur the grain a little so that it warps like image detail rather than aliasing.
    Plx_Image *soft = pgiThreadedSmoothImage(nullptr, base, nullptr, 0.7, nullptr);
    p.frame[0] = soft;
    p.frame[1] = plx_image_form_gen_gl_uc(nullptr, h, w);
    plx_image_fill_zero(p.frame[1]);
    // frame1(x) = frame0(motion^-1 x): the warp pulls through frame 1 -> frame 0.
    const double *m = &p.motion.m[0][0];
    const double det = m[0] * (m[4] * m[8] - m[5] * m[7]) - m[1] * (m[3] * m[8] - m[5] * m[6]) +
                       m[2] * (m[3] * m[7] - m[4] * m[6]);
    M3 inv{{{(m[4] * m[8] - m[5] * m[7]) / det, (m[2] * m[7] - m[1] * m[8]) / det, (m[1] * m[5] - m[2] * m[4]) / det},
            {(m[5] * m[6] - m[3] * m[8]) / det, (m[0] * m[8] - m[2] * m[6]) / det, (m[2] * m[3] - m[0] * m[5]) / det},
            {(m[3] * m[7] - m[4] * m[6]) / det, (m[1] * m[6] - m[0] * m[7]) / det, (m[0] * m[4] - m[1] * m[3]) / det}}};
    Plx_Matrix33 hi = to_plx(inv);
    bImageProjectiveWarp(p.frame[1], nullptr, nullptr, p.frame[0], nullptr, nullptr, &hi, nullptr, p.frame[1], nullptr,
                         nullptr, nullptr, 0);
    for (int r = 0; r < h; ++r) {
        auto *row = static_cast<uint8_t *>(plx_image_row(p.frame[1], r));
        for (int c = 0; c < w; ++c) row[c] = uint8_t(std::clamp(std::lround(1.1 * row[c] + grain(noise) / 4), 0L, 255L));
    }
    plx_image_free(base);
    plx_image_free(photo);
    return p;
}

const std::vector<Pair> &pairs_of(int w, int h)
{
    static std::map<int, std::vector<Pair>> made;
    std::vector<Pair> &pairs = made[w];
    for (int k = int(pairs.size()); k < kPairs; ++k) pairs.push_back(make_pair(w, h, k));
    return pairs;
}

// Top-left corners of the regions: one at the centre, or four around it.
std::vector<std::pair<int, int>> regions(int w, int h, int count)
{
    if (count == 1) return {{w / 2 - kRegion / 2, h / 2 - kRegion / 2}};
    return {{w / 4 - kRegion / 2, h / 4 - kRegion / 2 + 20},
            {3 * w / 4 - kRegion / 2, h / 4 - kRegion / 2 + 20},
            {w / 4 - kRegion / 2, 3 * h / 4 - kRegion / 2 - 20},
            {3 * w / 4 - kRegion / 2, 3 * h / 4 - kRegion / 2 - 20}};
}

// Mean distance of the region corners carried by an estimate (frame 0 -> frame 1) from
// where the true motion carries them.
double corner_error(const M3 &est, const M3 &motion, int x0, int y0)
{
    double sum = 0;
    for (int k = 0; k < 4; ++k) {
        const double x = x0 + (k == 1 || k == 2 ? kRegion : 0), y = y0 + (k >= 2 ? kRegion : 0);
        double u, v, tu, tv;
        apply(est, x, y, u, v);
        apply(motion, x, y, tu, tv);
        sum += std::hypot(u - tu, v - tv);
    }
    return sum / 4;
}

std::map<std::string, double> g_ms;
std::map<std::string, std::vector<double>> g_errors;  // per pair

double mean(const std::vector<double> &v)
{
    double sum = 0;
    for (double x : v) sum += x;
    return v.empty() ? 0.0 : sum / double(v.size());
}

// The corner error of every pair (untimed, once per case), then the timed frames taking the
// pairs in turn.
template <class Frame>
void run_frames(benchmark::State &state, const std::string &label, const std::vector<Pair> &pairs, Frame &frame)
{
    std::vector<double> &errors = g_errors[label];
    if (errors.empty())
        for (const Pair &p : pairs) errors.push_back(frame(p));
    std::size_t next = 0;
    for (auto _ : state) frame(pairs[next++ % pairs.size()]);
    state.counters["corner_px"] = mean(errors);
}

void track_plano(benchmark::State &state, std::string key, int w, int h, int count, uint32_t jobs)
{
    const std::vector<Pair> &pairs = pairs_of(w, h);
    PlanoHost *host = plano_host_new(jobs);
    Plx_Camera camera;
    plx_camera_build_linear(&camera, 1.0, 1.0, 1.0, 0.0, 0.0);
    const auto corners = regions(w, h, count);
    std::vector<Plx_Image *> masks;
    for (auto [x0, y0] : corners) {
        Plx_Image *mask = plx_image_form_gen_b(nullptr, h, w);
        plx_image_fill_zero(mask);
        const double one = 1.0;
        plx_image_fill_const_window(mask, Plx_Window{x0, y0, kRegion, kRegion}, &one);
        masks.push_back(mask);
    }
    const Plx_Matrix33 identity{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}};
    // One frame as a host tracks it; the mean corner error of its regions.
    auto frame = [&](const Pair &p) {
        Track *track = pTrackNew(p.frame[0], &camera, p.frame[1], &camera, kLevels, nullptr);
        std::vector<TrackRegion *> made;
        for (Plx_Image *mask : masks)
            made.push_back(pTrackRegion(track, mask, p.frame[0], &camera, nullptr, nullptr, &identity, nullptr, nullptr,
                                        kSmoothing, 32, 0.0, 0.0, 1.0, 16, 16, TRACK_MODEL_PROJ, 0.5, 0.0, 0.2, 100, 0.0,
                                        0, 0.0, 1, 0.0, kBlock, 2.0 / 255.0, 0.0, 9.0, nullptr, nullptr, nullptr, nullptr,
                                        nullptr, nullptr, nullptr, nullptr, nullptr, plano_host_interface(host)));
        if (!bTrackOptimise(track, kIterations, 0.001, 0.1, plano_host_interface(host))) state.SkipWithError("failed");
        double error = 0;
        for (std::size_t i = 0; i < made.size(); ++i) {
            Plx_Matrix33 est;
            bTrackMotionRead(made[i], &est);
            M3 e;
            std::memcpy(e.m, est.m, sizeof e.m);
            error += corner_error(e, p.motion, corners[i].first, corners[i].second) / double(made.size());
        }
        vTrackFree(track);
        return error;
    };
    run_frames(state, "plano/" + key, pairs, frame);
    for (Plx_Image *m : masks) plx_image_free(m);
    vThreadedWorkerPoolFree();
    plano_host_free(host);
}

#ifdef PLANO_HAVE_OPENCV
// ECC with the template cut from frame 0, coarse to fine over 4 levels, the warp starting at
// the template's place (template pixels -> frame 1 pixels).
void track_ecc(benchmark::State &state, std::string key, int w, int h, int count, int threads)
{
    const std::vector<Pair> &pairs = pairs_of(w, h);
    cv::setNumThreads(threads);
    const auto corners = regions(w, h, count);
    auto frame = [&](const Pair &p) {
        const cv::Mat f0(h, w, CV_8UC1, p.frame[0]->data, std::size_t(p.frame[0]->stride));
        const cv::Mat f1(h, w, CV_8UC1, p.frame[1]->data, std::size_t(p.frame[1]->stride));
        std::vector<cv::Mat> input{f1};
        for (int l = 1; l < kLevels; ++l) {
            cv::Mat down;
            cv::pyrDown(input.back(), down);
            input.push_back(down);
        }
        double error = 0;
        for (auto [x0, y0] : corners) {
            std::vector<cv::Mat> templ{f0(cv::Rect(x0, y0, kRegion, kRegion)).clone()};
            for (int l = 1; l < kLevels; ++l) {
                cv::Mat down;
                cv::pyrDown(templ.back(), down);
                templ.push_back(down);
            }
            // Pixel centres at integers in both: the same warp at every level up to scale.
            const double s = 1.0 / (1 << (kLevels - 1));
            cv::Mat warp = (cv::Mat_<float>(3, 3) << 1, 0, float(x0 * s), 0, 1, float(y0 * s), 0, 0, 1);
            for (int l = kLevels - 1; l >= 0; --l) {
                try {
                    cv::findTransformECC(templ[l], input[l], warp, cv::MOTION_HOMOGRAPHY,
                                         cv::TermCriteria(cv::TermCriteria::COUNT | cv::TermCriteria::EPS, kIterations,
                                                          1e-5),
                                         cv::noArray(), 1);
                } catch (const cv::Exception &) {
                    state.SkipWithError("ECC failed");
                    break;
                }
                if (l > 0) {  // to the next finer level: W' = S W S^-1 with S = diag(2, 2, 1)
                    warp.at<float>(0, 2) *= 2, warp.at<float>(1, 2) *= 2;
                    warp.at<float>(2, 0) /= 2, warp.at<float>(2, 1) /= 2;
                }
            }
            // Template (x - x0, y - y0) -> frame 1: as a map from frame 0 coordinates.
            M3 e{};
            for (int i = 0; i < 3; ++i)
                for (int j = 0; j < 3; ++j) e.m[i][j] = warp.at<float>(i, j);
            e = mul(e, shift(-x0, -y0));
            // OpenCV's pixel centres are integers, ours halves: ours = T(0.5) cv T(-0.5).
            e = mul(shift(0.5, 0.5), mul(e, shift(-0.5, -0.5)));
            error += corner_error(e, p.motion, x0, y0) / double(corners.size());
        }
        return error;
    };
    run_frames(state, "ecc/" + key, pairs, frame);
}
#endif

class MedianReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run> &runs) override
    {
        for (const Run &r : runs)
            if (r.run_type == Run::RT_Aggregate && r.aggregate_name == "median")
                g_ms[r.run_name.function_name] = r.GetAdjustedRealTime();
        ConsoleReporter::ReportRuns(runs);
    }
};

}  // namespace

int main(int argc, char **argv)
{
    const int sizes[][2] = {{1280, 720}, {1920, 1080}};
    std::vector<std::string> names;
    for (auto [w, h] : sizes)
        for (int count : {1, 4})
            for (int jobs : {1, 2}) {
                const std::string key =
                    std::to_string(h) + "p/regions:" + std::to_string(count) + "/jobs:" + std::to_string(jobs);
                names.push_back(key);
                benchmark::RegisterBenchmark(("plano/" + key).c_str(), track_plano, key, w, h, count, uint32_t(jobs))
                    ->Repetitions(5)->ReportAggregatesOnly(true)->Unit(benchmark::kMillisecond)->UseRealTime();
#ifdef PLANO_HAVE_OPENCV
                benchmark::RegisterBenchmark(("ecc/" + key).c_str(), track_ecc, key, w, h, count, jobs)
                    ->Repetitions(5)->ReportAggregatesOnly(true)->Unit(benchmark::kMillisecond)->UseRealTime();
#endif
            }
    benchmark::Initialize(&argc, argv);
    MedianReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    // The difference of the two errors is taken pair by pair (both saw the same noise), with
    // the standard error of its mean.
    std::printf("\nmedian ms per frame and mean corner error (px) over %d frame pairs\n%-24s %10s %10s %10s %10s %8s %22s\n",
                kPairs, "case", "plano ms", "plano px", "ECC ms", "ECC px", "ratio", "px difference");
    for (const std::string &k : names) {
        auto ms = [&](const std::string &who) {
            auto it = g_ms.find(who + "/" + k + "/repeats:5");
            if (it == g_ms.end()) it = g_ms.find(who + "/" + k);
            return it == g_ms.end() ? 0.0 : it->second;
        };
        const std::vector<double> &a = g_errors["plano/" + k], &b = g_errors["ecc/" + k];
        double d = 0, dd = 0;
        const std::size_t n = std::min(a.size(), b.size());
        for (std::size_t i = 0; i < n; ++i) d += a[i] - b[i], dd += (a[i] - b[i]) * (a[i] - b[i]);
        const double md = n ? d / double(n) : 0.0;
        const double se = n > 1 ? std::sqrt(std::max(0.0, dd / double(n) - md * md) / double(n - 1)) : 0.0;
        const double ours = ms("plano"), ecc = ms("ecc");
        std::printf("%-24s %10.2f %10.5f %10.2f %10.5f %8.2f %+11.5f +- %7.5f\n", k.c_str(), ours, mean(a), ecc, mean(b),
                    ecc > 0 ? ours / ecc : 0.0, md, se);
    }
    benchmark::Shutdown();
    return 0;
}
