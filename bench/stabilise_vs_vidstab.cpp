// The shot and the measurements of the stabilisation benchmark beside ffmpeg's vid.stab
// (bench/stabilise_vs_vidstab.sh runs the commands, times them and prints the table).
//
//   stabilise_vs_vidstab render DIR PHOTO   shaky plates DIR/shaky/%04d.png and the smooth
//                                           camera's view of every frame DIR/smooth/%04d.png
//   stabilise_vs_vidstab exact STAB.json CSV  residual jitter from plano stabilise's homographies
//   stabilise_vs_vidstab ecc DIR PATTERN CSV  residual jitter and kept area of rendered output
//                                             frames, measured against DIR/smooth by ECC
//
// The shot: a photograph on a plane, seen by a camera on a geometric similarity path (a pan
// with a slight turn and a push-in: frame f is the first frame's view moved by one fixed step
// f-1 times) plus per-frame jitter (a shift and a small turn about the frame's centre, drawn
// from a fixed seed). Residual jitter: scene points at a grid of positions in the smooth
// camera's view are followed into the stabilised output; after removing the one similarity
// that best maps the smooth view onto the output over the whole shot (a crop offset, a zoom),
// what is left is the residual. The high-frequency part is what is left after also removing
// each point's moving average over +-7 frames (a local straight line where the shot ends).
#include <algorithm>
#include <cmath>
#include <complex>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "opencv_peer.hpp"
#ifdef PLANO_HAVE_OPENCV
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wpedantic"
#pragma GCC diagnostic ignored "-Wdeprecated-enum-enum-conversion"
#include <opencv2/imgcodecs.hpp>
#pragma GCC diagnostic pop
#else
// Without OpenCV only the exact measurement is built; the rendering helpers stay unused.
#pragma GCC diagnostic ignored "-Wunused-function"
#endif

namespace {

constexpr int kWidth = 1280, kHeight = 720, kFrames = 120;
constexpr int kUpscale = 4;  // the 480x320 photograph becomes a 1920x1280 plane
constexpr int kAverageRadius = 7;
// The middle of the shot leaves out this many frames at either end, where a smoothing window
// (vid.stab's default reaches 15 frames either side) runs off the shot.
constexpr size_t kEnds = 15;

using C = std::complex<double>;

struct M3 {
    double m[3][3];
};

M3 mul(const M3 &a, const M3 &b)
{
    M3 c{};
    for (int i = 0; i < 3; ++i)
        for (int k = 0; k < 3; ++k)
            for (int j = 0; j < 3; ++j) c.m[i][k] += a.m[i][j] * b.m[j][k];
    return c;
}

M3 inv(const M3 &a)
{
    const auto &m = a.m;
    const double d = m[0][0] * (m[1][1] * m[2][2] - m[1][2] * m[2][1]) - m[0][1] * (m[1][0] * m[2][2] - m[1][2] * m[2][0]) +
                     m[0][2] * (m[1][0] * m[2][1] - m[1][1] * m[2][0]);
    M3 r;
    r.m[0][0] = (m[1][1] * m[2][2] - m[1][2] * m[2][1]) / d;
    r.m[0][1] = (m[0][2] * m[2][1] - m[0][1] * m[2][2]) / d;
    r.m[0][2] = (m[0][1] * m[1][2] - m[0][2] * m[1][1]) / d;
    r.m[1][0] = (m[1][2] * m[2][0] - m[1][0] * m[2][2]) / d;
    r.m[1][1] = (m[0][0] * m[2][2] - m[0][2] * m[2][0]) / d;
    r.m[1][2] = (m[0][2] * m[1][0] - m[0][0] * m[1][2]) / d;
    r.m[2][0] = (m[1][0] * m[2][1] - m[1][1] * m[2][0]) / d;
    r.m[2][1] = (m[0][1] * m[2][0] - m[0][0] * m[2][1]) / d;
    r.m[2][2] = (m[0][0] * m[1][1] - m[0][1] * m[1][0]) / d;
    return r;
}

C through(const M3 &h, C p)
{
    const double x = p.real(), y = p.imag();
    const double w = h.m[2][0] * x + h.m[2][1] * y + h.m[2][2];
    return {(h.m[0][0] * x + h.m[0][1] * y + h.m[0][2]) / w, (h.m[1][0] * x + h.m[1][1] * y + h.m[1][2]) / w};
}

M3 translation(double x, double y) { return {{{1, 0, x}, {0, 1, y}, {0, 0, 1}}}; }

// A similarity x -> a x + b on positions as complex numbers.
struct Similarity {
    C a{1, 0}, b{0, 0};
    C operator()(C p) const { return a * p + b; }
    Similarity then(const Similarity &next) const { return {next.a * a, next.a * b + next.b}; }
    Similarity inverse() const { return {1.0 / a, -b / a}; }
    Similarity power(double t) const  // the t-th power, t >= 0, along the principal logarithm
    {
        const C at = std::pow(a, t);
        return {at, std::abs(a - 1.0) < 1e-15 ? b * t : b * (at - 1.0) / (a - 1.0)};
    }
};

// Plate position to photograph-plane position, a similarity: scale s, turn by angle (radians)
// about the frame's centre, which lands on centre.
Similarity view(C centre, double scale, double angle)
{
    const C a = std::polar(scale, angle), frame_centre(kWidth / 2.0, kHeight / 2.0);
    return {a, centre - a * frame_centre};
}

// The smooth path: from the first view to the last by equal steps (a geometric path).
Similarity smooth_camera(int f)
{
    const Similarity first = view({700, 560}, 1.0, 0.0);
    const Similarity last = view({1180, 650}, 0.9, 2.0 * M_PI / 180);
    // The last frame's plate in the first's; one step is its 1/(n-1)-th power.
    const Similarity whole = last.then(first.inverse());
    const Similarity step = whole.power(1.0 / (kFrames - 1));
    return step.power(f - 1).then(first);
}

// Deterministic draws, the same on every platform.
double draw(uint64_t &state)
{
    state += 0x9E3779B97F4A7C15ull;
    uint64_t z = state;
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ull;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBull;
    z ^= z >> 31;
    return double(z >> 11) / double(1ull << 53) * 2 - 1;  // -1..1
}

// The jitter of frame f, plate to plate: up to 4 px along each axis and 0.3 degrees about
// the frame's centre. The shaky plate sees the plane through smooth(f) after jitter(f).
Similarity jitter(int f)
{
    uint64_t state = 17 + uint64_t(f) * 1000003ull;
    const double dx = 4 * draw(state), dy = 4 * draw(state), angle = 0.3 * M_PI / 180 * draw(state);
    const C a = std::polar(1.0, angle), centre(kWidth / 2.0, kHeight / 2.0);
    return {a, centre - a * centre + C(dx, dy)};
}

Similarity shaky_camera(int f) { return jitter(f).then(smooth_camera(f)); }

// Positions in the smooth camera's view whose scene points are followed.
std::vector<C> grid()
{
    std::vector<C> g;
    for (int j = 0; j < 5; ++j)
        for (int i = 0; i < 9; ++i) g.emplace_back(128 + 128 * i, 72 + 144 * j);
    return g;
}

struct Residual {
    double rms = 0, high = 0, middle = 0, worst_frame = 0;
    Similarity fixed;
    std::vector<double> frame_rms, frame_high;
};

// out[f][k]: where the output frame f shows the scene point at grid position k of the smooth
// view. The fixed similarity is fitted to all of them at once, in closed form.
Residual residual(const std::vector<std::vector<C>> &out)
{
    const std::vector<C> g = grid();
    C ms = 0, mq = 0;
    size_t n = 0;
    for (const auto &frame : out)
        for (size_t k = 0; k < g.size(); ++k, ++n) {
            ms += g[k];
            mq += frame[k];
        }
    ms /= double(n);
    mq /= double(n);
    C num = 0;
    double den = 0;
    for (const auto &frame : out)
        for (size_t k = 0; k < g.size(); ++k) {
            num += std::conj(g[k] - ms) * (frame[k] - mq);
            den += std::norm(g[k] - ms);
        }
    Residual r;
    r.fixed.a = num / den;
    r.fixed.b = mq - r.fixed.a * ms;
    const size_t frames = out.size();
    std::vector<std::vector<C>> e(frames, std::vector<C>(g.size()));
    for (size_t f = 0; f < frames; ++f)
        for (size_t k = 0; k < g.size(); ++k) e[f][k] = out[f][k] - r.fixed(g[k]);
    double all = 0, all_high = 0, all_middle = 0;
    for (size_t f = 0; f < frames; ++f) {
        double sum = 0, sum_high = 0;
        const size_t lo = f >= kAverageRadius ? f - kAverageRadius : 0, hi = std::min(frames - 1, f + kAverageRadius);
        for (size_t k = 0; k < g.size(); ++k) {
            // A straight line fitted over the window: the moving average inside the shot,
            // and no bias from a steady drift where the window is cut at either end.
            C mean = 0, slope = 0;
            double tm = 0, tt = 0;
            for (size_t i = lo; i <= hi; ++i) {
                mean += e[i][k];
                tm += double(i);
            }
            mean /= double(hi - lo + 1);
            tm /= double(hi - lo + 1);
            for (size_t i = lo; i <= hi; ++i) {
                slope += (double(i) - tm) * (e[i][k] - mean);
                tt += (double(i) - tm) * (double(i) - tm);
            }
            const C trend = mean + slope / tt * (double(f) - tm);
            sum += std::norm(e[f][k]);
            sum_high += std::norm(e[f][k] - trend);
        }
        r.frame_rms.push_back(std::sqrt(sum / double(g.size())));
        r.frame_high.push_back(std::sqrt(sum_high / double(g.size())));
        r.worst_frame = std::max(r.worst_frame, r.frame_rms.back());
        all += sum;
        all_high += sum_high;
        if (f >= kEnds && f + kEnds < frames) all_middle += sum;
    }
    r.middle = std::sqrt(all_middle / double((frames - 2 * kEnds) * g.size()));
    r.rms = std::sqrt(all / double(frames * g.size()));
    r.high = std::sqrt(all_high / double(frames * g.size()));
    return r;
}

void report(const Residual &r, double kept, const std::string &csv, const std::vector<double> &frame_kept)
{
    std::printf("rms=%.4f high=%.4f middle=%.4f worst_frame=%.4f kept=%.4f fixed_scale=%.5f fixed_degrees=%.4f fixed_x=%.2f "
                "fixed_y=%.2f\n",
                r.rms, r.high, r.middle, r.worst_frame, kept, std::abs(r.fixed.a), std::arg(r.fixed.a) * 180 / M_PI,
                r.fixed.b.real(), r.fixed.b.imag());
    std::ofstream out(csv);
    out << "frame,rms_px,high_frequency_px,kept_area\n";
    for (size_t f = 0; f < r.frame_rms.size(); ++f)
        out << f + 1 << ',' << r.frame_rms[f] << ',' << r.frame_high[f] << ','
            << (frame_kept.empty() ? kept : frame_kept[f]) << '\n';
}

// plano stabilise's JSON gives plate-to-output homographies, so the output position of a
// scene point is exact: smooth view -> shaky plate (the jitter's inverse) -> output.
int exact(const std::string &path, const std::string &csv)
{
    std::ifstream in(path);
    const nlohmann::json j = nlohmann::json::parse(in);
    const auto &frames = j.at("frames");
    if (frames.size() != size_t(kFrames)) {
        std::fprintf(stderr, "%s: %zu frames, not %d\n", path.c_str(), frames.size(), kFrames);
        return 1;
    }
    std::vector<std::vector<C>> out;
    for (int f = 1; f <= kFrames; ++f) {
        M3 H;
        for (int i = 0; i < 3; ++i)
            for (int k = 0; k < 3; ++k) H.m[i][k] = frames[size_t(f - 1)].at("stabilise")[size_t(i)][size_t(k)].get<double>();
        const Similarity to_plate = jitter(f).inverse();
        std::vector<C> row;
        for (C s : grid()) row.push_back(through(H, to_plate(s)));
        out.push_back(row);
    }
    const auto &box = j.at("box");
    const double kept = box[2].get<double>() * box[3].get<double>() / (double(kWidth) * kHeight);
    report(residual(out), kept, csv, {});
    return 0;
}

#ifdef PLANO_HAVE_OPENCV

std::string frame_path(const std::string &pattern, int f)
{
    char name[4096];
    std::snprintf(name, sizeof name, pattern.c_str(), f);
    return name;
}

int render(const std::string &dir, const std::string &photo_path)
{
    const cv::Mat photo = cv::imread(photo_path, cv::IMREAD_COLOR);
    if (photo.empty()) {
        std::fprintf(stderr, "cannot read %s\n", photo_path.c_str());
        return 1;
    }
    // The photograph, upscaled smoothly, with a fine texture on the plane (a surface's grain:
    // detail at the plate's own scale, which a 4x upscale lacks). The texture is value noise
    // on a 3-pixel lattice, +-12 levels, bilinear between lattice points.
    cv::Mat plane;
    photo.convertTo(plane, CV_32FC3);
    cv::resize(plane, plane, cv::Size(), kUpscale, kUpscale, cv::INTER_CUBIC);
    const int cell = 3, lw = plane.cols / cell + 2, lh = plane.rows / cell + 2;
    std::vector<float> lattice(size_t(lw) * lh);
    uint64_t state = 5;
    for (float &v : lattice) v = float(12 * draw(state));
    for (int y = 0; y < plane.rows; ++y)
        for (int x = 0; x < plane.cols; ++x) {
            const double u = (x + 0.5) / cell, v = (y + 0.5) / cell;
            const int i = int(u), k = int(v);
            const double fu = u - i, fv = v - k;
            const double t = (1 - fv) * ((1 - fu) * lattice[size_t(k) * lw + i] + fu * lattice[size_t(k) * lw + i + 1]) +
                             fv * ((1 - fu) * lattice[size_t(k + 1) * lw + i] + fu * lattice[size_t(k + 1) * lw + i + 1]);
            cv::Vec3f &p = plane.at<cv::Vec3f>(y, x);
            for (int c = 0; c < 3; ++c) p[c] = std::clamp(p[c] + float(t), 0.f, 255.f);
        }
    // Pixel (c, r) covers [c, c+1) x [r, r+1): its centre goes through the camera, and the
    // plane is sampled bilinearly about its own pixel centres.
    auto render_view = [&](const Similarity &camera, const std::string &path) {
        cv::Mat out(kHeight, kWidth, CV_8UC3);
        for (int r = 0; r < kHeight; ++r)
            for (int c = 0; c < kWidth; ++c) {
                const C p = camera(C(c + 0.5, r + 0.5));
                const double x = p.real() - 0.5, y = p.imag() - 0.5;
                const int x0 = int(std::floor(x)), y0 = int(std::floor(y));
                if (x0 < 0 || y0 < 0 || x0 + 1 >= plane.cols || y0 + 1 >= plane.rows) {
                    std::fprintf(stderr, "frame %s leaves the plane at pixel %d,%d\n", path.c_str(), c, r);
                    return false;
                }
                const double fx = x - x0, fy = y - y0;
                const cv::Vec3f &a = plane.at<cv::Vec3f>(y0, x0), &b = plane.at<cv::Vec3f>(y0, x0 + 1),
                                &d = plane.at<cv::Vec3f>(y0 + 1, x0), &e = plane.at<cv::Vec3f>(y0 + 1, x0 + 1);
                cv::Vec3b &o = out.at<cv::Vec3b>(r, c);
                for (int k = 0; k < 3; ++k)
                    o[k] = cv::saturate_cast<uint8_t>((1 - fy) * ((1 - fx) * a[k] + fx * b[k]) + fy * ((1 - fx) * d[k] + fx * e[k]));
            }
        return cv::imwrite(path, out);
    };
    for (const char *sub : {"shaky", "smooth"}) std::filesystem::create_directories(dir + "/" + sub);
    for (int f = 1; f <= kFrames; ++f) {
        char name[32];
        std::snprintf(name, sizeof name, "/%04d.png", f);
        if (!render_view(shaky_camera(f), dir + "/shaky" + name) || !render_view(smooth_camera(f), dir + "/smooth" + name))
            return 1;
    }
    return 0;
}

cv::Mat grey(const cv::Mat &bgr)
{
    cv::Mat g, f;
    cv::cvtColor(bgr, g, cv::COLOR_BGR2GRAY);
    g.convertTo(f, CV_32F);
    return f;
}

// Our positions (pixel corners at integers) to OpenCV's (pixel centres at integers) at a
// pyramid level of 2^-level, and back.
M3 to_cv(const M3 &G, int level)
{
    const double s = std::ldexp(1.0, -level);
    const M3 D{{{s, 0, 0}, {0, s, 0}, {0, 0, 1}}}, Dinv{{{1 / s, 0, 0}, {0, 1 / s, 0}, {0, 0, 1}}};
    return mul(translation(-0.5, -0.5), mul(D, mul(G, mul(Dinv, translation(0.5, 0.5)))));
}
M3 from_cv(const M3 &W, int level)
{
    const double s = std::ldexp(1.0, -level);
    const M3 D{{{s, 0, 0}, {0, s, 0}, {0, 0, 1}}}, Dinv{{{1 / s, 0, 0}, {0, 1 / s, 0}, {0, 0, 1}}};
    return mul(Dinv, mul(translation(0.5, 0.5), mul(W, mul(translation(-0.5, -0.5), D))));
}

// The homography from the smooth view's positions to the output's, coarse to fine from a
// guess; returns the correlation at the finest level (negative when ECC failed).
double ecc(const cv::Mat &smooth, const cv::Mat &output, const cv::Mat &mask, M3 &G, int kLevels)
{
    std::vector<cv::Mat> t{smooth}, o{output}, m{mask};
    for (int l = 1; l < kLevels; ++l) {
        cv::Mat a, b, c;
        cv::pyrDown(t.back(), a);
        cv::pyrDown(o.back(), b);
        cv::resize(m.back(), c, b.size(), 0, 0, cv::INTER_NEAREST);
        t.push_back(a);
        o.push_back(b);
        m.push_back(c);
    }
    double rho = -1;
    for (int l = kLevels - 1; l >= 0; --l) {
        const M3 W = to_cv(G, l);
        cv::Mat warp(3, 3, CV_32F);
        for (int i = 0; i < 3; ++i)
            for (int k = 0; k < 3; ++k) warp.at<float>(i, k) = float(W.m[i][k] / W.m[2][2]);
        try {
            rho = cv::findTransformECC(t[size_t(l)], o[size_t(l)], warp, cv::MOTION_HOMOGRAPHY,
                                       cv::TermCriteria(cv::TermCriteria::COUNT + cv::TermCriteria::EPS, l == 0 ? 30 : 50, 1e-6),
                                       m[size_t(l)], l == 0 ? 3 : 5);
        } catch (const cv::Exception &) {
            return -1;
        }
        M3 Wn;
        for (int i = 0; i < 3; ++i)
            for (int k = 0; k < 3; ++k) Wn.m[i][k] = warp.at<float>(i, k);
        G = from_cv(Wn, l);
    }
    return rho;
}

// The largest axis-aligned rectangle of set pixels (a histogram of runs per row).
double largest_rectangle(const cv::Mat &valid)
{
    std::vector<int> height(size_t(valid.cols) + 1, 0);
    double best = 0;
    for (int r = 0; r < valid.rows; ++r) {
        for (int c = 0; c < valid.cols; ++c) height[size_t(c)] = valid.at<uint8_t>(r, c) ? height[size_t(c)] + 1 : 0;
        std::vector<int> stack;
        for (int c = 0; c <= valid.cols; ++c) {
            while (!stack.empty() && height[size_t(stack.back())] >= height[size_t(c)]) {
                const int h = height[size_t(stack.back())];
                stack.pop_back();
                const int left = stack.empty() ? 0 : stack.back() + 1;
                best = std::max(best, double(h) * (c - left));
            }
            stack.push_back(c);
        }
    }
    return best;
}

// Output pixels showing the plate (their centres land within the plate's outermost pixel
// centres, so that bilinear interpolation reads only the plate): smooth view -> output is G, the plate is the
// smooth view through the jitter's inverse.
cv::Mat covered(const M3 &G, int f, cv::Size size)
{
    const M3 Ginv = inv(G);
    const Similarity to_plate = jitter(f).inverse();
    cv::Mat valid(size, CV_8U);
    for (int r = 0; r < size.height; ++r)
        for (int c = 0; c < size.width; ++c) {
            const C p = to_plate(through(Ginv, C(c + 0.5, r + 0.5)));
            valid.at<uint8_t>(r, c) =
                p.real() >= 0.5 && p.imag() >= 0.5 && p.real() <= kWidth - 0.5 && p.imag() <= kHeight - 0.5;
        }
    return valid;
}

// Output frames measured against the smooth camera's rendering: the homography between them
// by ECC, then the scene points through it. Kept area: the largest box every frame covers, in
// plate pixels (divided by the output's scale over the plate), over the frame's area.
int measure(const std::string &dir, const std::string &pattern, const std::string &csv)
{
    std::vector<std::vector<C>> out;
    std::vector<M3> warps;
    cv::Mat common;
    M3 G{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}};
    double worst_rho = 1;
    for (int f = 1; f <= kFrames; ++f) {
        const cv::Mat shown = cv::imread(frame_path(pattern, f), cv::IMREAD_COLOR);
        const cv::Mat smooth = cv::imread(frame_path(dir + "/smooth/%04d.png", f), cv::IMREAD_COLOR);
        if (shown.empty() || smooth.empty()) {
            std::fprintf(stderr, "cannot read frame %d of %s\n", f, pattern.c_str());
            return 1;
        }
        // Black fill is not picture; beyond the first frame, neither is what lies outside the
        // plate as the last frame's homography places it (fills with earlier frames).
        cv::Mat mask;
        cv::Mat channels_max;
        cv::cvtColor(shown, channels_max, cv::COLOR_BGR2GRAY);
        mask = channels_max > 3;
        cv::erode(mask, mask, cv::Mat(), cv::Point(-1, -1), 2);
        double rho;
        if (f == 1) {
            // The first frame's placement is unknown (a crop box anywhere, a zoom): search a few
            // zooms of the output over the smooth view at an eighth of the size, then refine.
            const cv::Mat t = grey(smooth), o = grey(shown);
            cv::Mat small_t;
            cv::resize(t, small_t, cv::Size(), 0.125, 0.125, cv::INTER_AREA);
            double score = -2;
            for (double z = 0.9; z <= 1.35; z += 0.01) {
                cv::Mat small_o, match;
                cv::resize(o, small_o, cv::Size(), 0.125 / z, 0.125 / z, cv::INTER_AREA);
                if (small_o.cols > small_t.cols || small_o.rows > small_t.rows) continue;
                cv::matchTemplate(small_t, small_o, match, cv::TM_CCOEFF_NORMED);
                double best;
                cv::Point at;
                cv::minMaxLoc(match, nullptr, &best, nullptr, &at);
                if (best > score) {
                    score = best;
                    // The output's position x lands on the smooth view's 8 at + x / z.
                    G = {{{z, 0, -8.0 * at.x * z}, {0, z, -8.0 * at.y * z}, {0, 0, 1}}};
                }
            }
            rho = ecc(t, o, mask, G, 4);
        } else {
            mask &= covered(G, f, shown.size());
            cv::erode(mask, mask, cv::Mat(), cv::Point(-1, -1), 2);
            rho = ecc(grey(smooth), grey(shown), mask, G, 3);  // from the last frame's, a few px away
        }
        if (rho < 0) {
            std::fprintf(stderr, "ECC failed on frame %d of %s\n", f, pattern.c_str());
            return 1;
        }
        worst_rho = std::min(worst_rho, rho);
        warps.push_back(G);
        std::vector<C> row;
        for (C s : grid()) row.push_back(through(G, s));
        out.push_back(row);
        const cv::Mat valid = covered(G, f, shown.size());
        common = common.empty() ? valid : (common & valid);
    }
    const double box = largest_rectangle(common);
    std::vector<double> frame_kept;
    double kept = 0;
    for (const M3 &W : warps) {
        // The output's area per plate area: the Jacobian's determinant at the frame's centre.
        const C c(kWidth / 2.0, kHeight / 2.0), h = 0.5;
        const C dx = (through(W, c + h) - through(W, c - h)), dy = (through(W, c + C(0, 0.5)) - through(W, c - C(0, 0.5)));
        const double det = std::fabs(dx.real() * dy.imag() - dx.imag() * dy.real());
        frame_kept.push_back(box / det / (double(kWidth) * kHeight));
        kept += frame_kept.back();
    }
    kept /= double(warps.size());
    std::printf("worst_ecc=%.5f ", worst_rho);
    report(residual(out), kept, csv, frame_kept);
    return 0;
}

#endif

}  // namespace

int main(int argc, char **argv)
{
    const std::string what = argc > 1 ? argv[1] : "";
    if (what == "exact" && argc == 4) return exact(argv[2], argv[3]);
#ifdef PLANO_HAVE_OPENCV
    if (what == "render" && argc == 4) return render(argv[2], argv[3]);
    if (what == "ecc" && argc == 5) return measure(argv[2], argv[3], argv[4]);
#else
    if (what == "render" || what == "ecc") {
        std::fprintf(stderr, "%s needs OpenCV (libopencv-dev)\n", what.c_str());
        return 1;
    }
#endif
    std::fprintf(stderr,
                 "usage: %s render DIR PHOTO | exact STAB.json CSV | ecc DIR PATTERN CSV\n"
                 "(bench/stabilise_vs_vidstab.sh runs the whole comparison)\n",
                 argv[0]);
    return 2;
}
