// Tracking accuracy on sequences built from a real photograph (tests/data/coffee_grey.pgm)
// under known homographies, with changing gain and sensor noise, tracked frame to frame the
// way a host does it: one Track per frame pair, the first frame as the reference, each
// frame starting from the previous frame's answer. Corner errors are measured against the
// homographies the frames were rendered with.
#include <gtest/gtest.h>

#include <Eigen/Dense>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "plano/projective_warp.h"
#include "plano/track.h"
#include "plano_host/host.h"

namespace {

using Mat3 = Eigen::Matrix3d;

struct ImageFree {
    void operator()(Plx_Image *im) const { plx_image_free(im); }
};
using Image = std::unique_ptr<Plx_Image, ImageFree>;

// The photograph as 8-bit grey (binary PGM).
Image load_photo()
{
    const std::string path = std::string(PLANO_TEST_DATA) + "/../data/coffee_grey.pgm";
    FILE *f = std::fopen(path.c_str(), "rb");
    if (f == nullptr) return nullptr;
    int w = 0, h = 0, maxval = 0;
    char magic[3] = {};
    Image im;
    if (std::fscanf(f, "%2s %d %d %d", magic, &w, &h, &maxval) == 4 && std::strcmp(magic, "P5") == 0 &&
        maxval == 255 && std::fgetc(f) != EOF) {
        im.reset(plx_image_form_gen_gl_uc(nullptr, h, w));
        for (int r = 0; r < h && im; ++r)
            if (std::fread(plx_image_row(im.get(), r), 1, std::size_t(w), f) != std::size_t(w)) im.reset();
    }
    std::fclose(f);
    return im;
}

Plx_Matrix33 to_plx(const Mat3 &m)
{
    Plx_Matrix33 p{};
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j) p.m[i][j] = m(i, j);
    return p;
}

Mat3 from_plx(const Plx_Matrix33 &p)
{
    Mat3 m;
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j) m(i, j) = p.m[i][j];
    return m;
}

Eigen::Vector2d apply(const Mat3 &H, Eigen::Vector2d p)
{
    const Eigen::Vector3d q = H * Eigen::Vector3d(p.x(), p.y(), 1.0);
    return q.head<2>() / q.z();
}

Mat3 translation(double x, double y)
{
    Mat3 t = Mat3::Identity();
    t(0, 2) = x;
    t(1, 2) = y;
    return t;
}

// Motion of the camera at frame k, as the map from photograph to frame coordinates.
struct Motion {
    double tx = 0, ty = 0, angle = 0, scale = 0, shear = 0, px = 0, py = 0;  // amplitudes
    Mat3 at(int k, double cx, double cy) const
    {
        const double a = angle * std::sin(0.35 * k), s = 1.0 + scale * std::sin(0.27 * k);
        Mat3 m = Mat3::Identity();
        m(0, 0) = s * std::cos(a), m(0, 1) = -s * std::sin(a) + shear * std::sin(0.3 * k);
        m(1, 0) = s * std::sin(a), m(1, 1) = s * std::cos(a);
        m(2, 0) = px * std::sin(0.2 * k), m(2, 1) = py * std::cos(0.25 * k);
        return translation(cx + tx * std::sin(0.5 * k), cy + ty * std::sin(0.45 * k + 1.0)) * m *
               translation(-cx, -cy);
    }
};

// Frames of the photograph under a motion, with gain 0.7 to 1.3 and noise; truth[k] maps
// frame 0 to frame k.
struct Sequence {
    std::vector<Image> frames;
    std::vector<Mat3> truth;
};

Sequence render(const Plx_Image *photo, const Motion &motion, int count, double noise, uint32_t seed)
{
    Sequence seq;
    const double cx = photo->width / 2.0, cy = photo->height / 2.0;
    const Mat3 first = motion.at(0, cx, cy);
    std::mt19937 rng(seed);
    std::normal_distribution<double> gauss(0.0, noise);
    for (int k = 0; k < count; ++k) {
        const Mat3 g = motion.at(k, cx, cy);
        Image frame(plx_image_form_gen_gl_uc(nullptr, photo->height, photo->width));
        plx_image_fill_zero(frame.get());
        const Plx_Matrix33 to_photo = to_plx(g.inverse());
        EXPECT_TRUE(bImageProjectiveWarp(frame.get(), nullptr, nullptr, photo, nullptr, nullptr, &to_photo, nullptr,
                                         frame.get(), nullptr, nullptr, nullptr, 0));
        // Scaled to three quarters first, so that the largest gain does not clip.
        const double gain = 0.75 * (1.0 + 0.3 * std::sin(0.4 * k + 0.5));
        for (int r = 0; r < frame->height; ++r) {
            auto *row = static_cast<uint8_t *>(plx_image_row(frame.get(), r));
            for (int c = 0; c < frame->width; ++c)
                row[c] = uint8_t(std::clamp(std::lround(gain * row[c] + gauss(rng)), 0L, 255L));
        }
        seq.frames.push_back(std::move(frame));
        seq.truth.push_back(g * first.inverse());
    }
    return seq;
}

// Bit mask of the pixels whose centres lie inside a convex quadrilateral.
Image quad_mask(int32_t h, int32_t w, const std::vector<Eigen::Vector2d> &q)
{
    Image mask(plx_image_form_gen_b(nullptr, h, w));
    plx_image_fill_zero(mask.get());
    double area = 0;
    for (int i = 0; i < 4; ++i) {
        const Eigen::Vector2d &a = q[i], &b = q[(i + 1) % 4];
        area += a.x() * b.y() - a.y() * b.x();
    }
    for (int32_t r = 0; r < h; ++r)
        for (int32_t c = 0; c < w; ++c) {
            const Eigen::Vector2d p(c + 0.5, r + 0.5);
            bool inside = true;
            for (int i = 0; i < 4 && inside; ++i) {
                const Eigen::Vector2d e = q[(i + 1) % 4] - q[i], d = p - q[i];
                inside = (e.x() * d.y() - e.y() * d.x()) * area >= 0;
            }
            if (inside) static_cast<uint32_t *>(plx_image_row(mask.get(), r))[c >> 5] |= 1u << (c & 31);
        }
    return mask;
}

struct Settings {
    uint32_t model = TRACK_MODEL_PROJ;
    uint32_t levels = 4;
    uint32_t correlation_size = 32;
    double rotation_range = 0, scale_range = 0;
    uint32_t search = 40;
    uint32_t min_pixels = 100;
    double texture = 0.0;
    int32_t iterations = 20;
};

struct Tracker {
    Plx_Camera camera{};
    PlanoHost *host;
    Settings settings;
    // 0 jobs: no host at all.
    explicit Tracker(uint32_t jobs, Settings s = {}) : host(jobs ? plano_host_new(jobs) : nullptr), settings(s)
    {
        plx_camera_build_linear(&camera, 1.0, 1.0, 1.0, 0.0, 0.0);
    }
    ~Tracker() { plano_host_free(host); }

    TrackRegion *add(Track *track, Plx_Image *previous_mask, Plx_Image *reference, Plx_Image *reference_mask,
                     const Mat3 &start) const
    {
        const Plx_Matrix33 h = to_plx(start);
        const Settings &s = settings;
        return pTrackRegion(track, previous_mask, reference, &camera, reference_mask, nullptr, &h, nullptr, nullptr,
                            0.8, s.correlation_size, s.rotation_range, s.scale_range, 1.0, s.search, s.search, s.model,
                            0.5, s.texture, 0.2, s.min_pixels, 0.0, 1, 0.0, 1, 0.0, 8, 2.0 / 255.0, 0.0, 9.0, nullptr,
                            nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
                            plano_host_interface(host));
    }

    // Tracks one region (the quad in frame 0) through the sequence; the estimated maps from
    // frame 0 to each frame, and the statuses.
    std::vector<Mat3> run(const Sequence &seq, const std::vector<Eigen::Vector2d> &quad,
                          std::vector<uint32_t> *statuses = nullptr) const
    {
        Plx_Image *first = seq.frames[0].get();
        Image reference_mask = quad_mask(first->height, first->width, quad);
        std::vector<Mat3> est{Mat3::Identity()};
        for (std::size_t k = 1; k < seq.frames.size(); ++k) {
            std::vector<Eigen::Vector2d> moved;
            for (const auto &p : quad) moved.push_back(apply(est.back(), p));
            Image previous_mask = quad_mask(first->height, first->width, moved);
            Track *track = pTrackNew(seq.frames[k - 1].get(), &camera, seq.frames[k].get(), &camera, settings.levels,
                                     nullptr);
            EXPECT_NE(track, nullptr);
            if (track == nullptr) break;
            TrackRegion *region = add(track, previous_mask.get(), first, reference_mask.get(), est.back());
            EXPECT_NE(region, nullptr);
            if (region == nullptr) {
                vTrackFree(track);
                break;
            }
            EXPECT_TRUE(bTrackOptimise(track, settings.iterations, 0.001, 0.1, plano_host_interface(host)));
            Plx_Matrix33 h{};
            bTrackMotionRead(region, &h);
            if (statuses != nullptr) statuses->push_back(region->status);
            est.push_back(from_plx(h) / h.m[2][2]);
            vTrackFree(track);
        }
        return est;
    }
};

std::vector<Eigen::Vector2d> centre_quad(const Plx_Image *im, double half_w, double half_h)
{
    const double cx = im->width / 2.0, cy = im->height / 2.0;
    return {{cx - half_w, cy - half_h}, {cx + half_w, cy - half_h}, {cx + half_w, cy + half_h}, {cx - half_w, cy + half_h}};
}

struct CornerErrors {
    double mean = 0, max = 0;
};

CornerErrors corner_errors(const Sequence &seq, const std::vector<Mat3> &est, const std::vector<Eigen::Vector2d> &quad)
{
    CornerErrors e;
    int n = 0;
    for (std::size_t k = 1; k < est.size(); ++k)
        for (const auto &p : quad) {
            const double d = (apply(est[k], p) - apply(seq.truth[k], p)).norm();
            e.mean += d;
            e.max = std::max(e.max, d);
            ++n;
        }
    if (n > 0) e.mean /= n;
    return e;
}

class TrackAccuracy : public ::testing::Test {
protected:
    static void SetUpTestSuite() { photo_ = load_photo().release(); }
    static void TearDownTestSuite() { plx_image_free(photo_); }
    void SetUp() override { ASSERT_NE(photo_, nullptr) << "tests/data/coffee_grey.pgm missing"; }
    static Plx_Image *photo_;
};
Plx_Image *TrackAccuracy::photo_ = nullptr;

constexpr int kFrames = 31;

TEST_F(TrackAccuracy, EveryModelFollowsItsOwnKindOfMotion)
{
    struct Case {
        uint32_t model;
        Motion motion;
        double mean, max;
    };
    const double deg = M_PI / 180.0;
    const Case cases[] = {
        {TRACK_MODEL_PROJ, {60, 40, 10 * deg, 0.05, 0.03, 2e-4, 1.5e-4}, 0.25, 1.0},
        {TRACK_MODEL_AFFINE, {60, 40, 10 * deg, 0.05, 0.03, 0, 0}, 0.25, 1.0},
        {TRACK_MODEL_TRANS_ROT_SCALE, {60, 40, 10 * deg, 0.05, 0, 0, 0}, 0.25, 1.0},
        {TRACK_MODEL_TRANS_SCALE, {60, 40, 0, 0.05, 0, 0, 0}, 0.25, 1.0},
        {TRACK_MODEL_TRANSLATE, {60, 40, 0, 0, 0, 0, 0}, 0.05, 0.2},
    };
    for (const Case &c : cases) {
        const Sequence seq = render(photo_, c.motion, kFrames, 1.5, 7 + c.model);
        Settings s;
        s.model = c.model;
        Tracker tracker(2, s);
        const auto quad = centre_quad(photo_, 70, 50);
        std::vector<uint32_t> statuses;
        const std::vector<Mat3> est = tracker.run(seq, quad, &statuses);
        ASSERT_EQ(est.size(), seq.frames.size()) << "model " << c.model;
        for (std::size_t k = 0; k < statuses.size(); ++k) EXPECT_EQ(statuses[k], TRACK_REGION_OK) << k + 1;
        const CornerErrors e = corner_errors(seq, est, quad);
        EXPECT_LE(e.mean, c.mean) << "model " << c.model << " max " << e.max;
        EXPECT_LE(e.max, c.max) << "model " << c.model << " mean " << e.mean;
        std::printf("model %u: mean corner error %.3f px, largest %.3f px\n", c.model, e.mean, e.max);
    }
}

TEST_F(TrackAccuracy, SameResultsWithoutAHostAndForOneAndFourJobs)
{
    const Sequence seq = render(photo_, {60, 40, 0.1, 0.05, 0.03, 2e-4, 1.5e-4}, 6, 1.5, 3);
    const auto quad = centre_quad(photo_, 70, 50);
    const std::vector<Mat3> none = Tracker(0).run(seq, quad);
    for (uint32_t jobs : {1u, 4u}) {
        const std::vector<Mat3> est = Tracker(jobs).run(seq, quad);
        ASSERT_EQ(est.size(), none.size());
        for (std::size_t k = 0; k < est.size(); ++k)
            EXPECT_EQ(std::memcmp(est[k].data(), none[k].data(), sizeof(double) * 9), 0)
                << jobs << " jobs, frame " << k;
    }
}

TEST_F(TrackAccuracy, RotationSweepFindsAFortyDegreeTurn)
{
    // Two frames: the second turned by 40 degrees about the centre, far beyond what the
    // optimiser alone pulls in.
    const double a = 40.0 * M_PI / 180.0;
    Motion turn;
    turn.angle = a / std::sin(0.35);  // frame 1 of the motion's sine
    Sequence seq = render(photo_, turn, 2, 1.0, 11);
    seq.truth[1] = turn.at(1, photo_->width / 2.0, photo_->height / 2.0) *
                   turn.at(0, photo_->width / 2.0, photo_->height / 2.0).inverse();
    Settings s;
    s.model = TRACK_MODEL_TRANS_ROT_SCALE;
    s.rotation_range = 50.0 * M_PI / 180.0;
    s.search = 16;
    Tracker tracker(2, s);
    const auto quad = centre_quad(photo_, 60, 60);
    std::vector<uint32_t> statuses;
    const std::vector<Mat3> est = tracker.run(seq, quad, &statuses);
    ASSERT_EQ(est.size(), 2u);
    EXPECT_EQ(statuses[0], TRACK_REGION_OK);
    const CornerErrors e = corner_errors(seq, est, quad);
    EXPECT_LE(e.max, 1.0) << "mean " << e.mean;
}

TEST_F(TrackAccuracy, RegionSlidingOutOfViewIsReported)
{
    // The picture slides left by 8 pixels a frame and a region near the left edge leaves
    // the frame: it is followed while enough of it shows, then reported out of view rather
    // than tracked onto the border.
    Plx_Image *first = photo_;
    Sequence seq;
    for (int k = 0; k < 9; ++k) {
        seq.truth.push_back(translation(-8.0 * k, 0));
        Image frame(plx_image_form_gen_gl_uc(nullptr, first->height, first->width));
        plx_image_fill_zero(frame.get());
        const Plx_Matrix33 to_photo = to_plx(translation(8.0 * k, 0));
        ASSERT_TRUE(bImageProjectiveWarp(frame.get(), nullptr, nullptr, first, nullptr, nullptr, &to_photo, nullptr,
                                         frame.get(), nullptr, nullptr, nullptr, 0));
        seq.frames.push_back(std::move(frame));
    }
    Settings s;
    s.model = TRACK_MODEL_TRANSLATE;
    s.correlation_size = TRACK_NO_CORRELATION;  // the visibility test instead of the search
    Tracker tracker(1, s);
    const std::vector<Eigen::Vector2d> quad = {{10, 120}, {70, 120}, {70, 200}, {10, 200}};
    std::vector<uint32_t> statuses;
    const std::vector<Mat3> est = tracker.run(seq, quad, &statuses);
    ASSERT_EQ(statuses.size(), 8u);
    // Frames 1 to 4 start from a region at least half in view and are followed.
    for (int k = 1; k <= 4; ++k) {
        EXPECT_EQ(statuses[k - 1], TRACK_REGION_OK) << k;
        EXPECT_NEAR(est[k](0, 2), -8.0 * k, 0.1) << k;
    }
    EXPECT_EQ(statuses.back(), TRACK_REGION_OUT_OF_VIEW);
}

TEST_F(TrackAccuracy, ConstraintPointTiesTwoRegionsTogether)
{
    // Two regions left and right of a point that neither covers; the point's position in the
    // next frame is estimated from both and must agree with where each region carries it.
    const Sequence seq = render(photo_, {12, 8, 0.04, 0.03, 0.0, 1e-4, 5e-5}, 2, 1.0, 5);
    Tracker tracker(2);
    Plx_Image *first = seq.frames[0].get();
    const double cx = first->width / 2.0, cy = first->height / 2.0;
    const std::vector<Eigen::Vector2d> left = {{cx - 150, cy - 60}, {cx - 30, cy - 60}, {cx - 30, cy + 60}, {cx - 150, cy + 60}};
    const std::vector<Eigen::Vector2d> right = {{cx + 30, cy - 60}, {cx + 150, cy - 60}, {cx + 150, cy + 60}, {cx + 30, cy + 60}};
    Image left_mask = quad_mask(first->height, first->width, left);
    Image right_mask = quad_mask(first->height, first->width, right);
    Track *track = pTrackNew(first, &tracker.camera, seq.frames[1].get(), &tracker.camera, 4, nullptr);
    ASSERT_NE(track, nullptr);
    TrackRegion *a = tracker.add(track, left_mask.get(), first, left_mask.get(), Mat3::Identity());
    TrackRegion *b = tracker.add(track, right_mask.get(), first, right_mask.get(), Mat3::Identity());
    ASSERT_TRUE(a && b);
    const double point[2] = {cx, cy}, info[3] = {100.0, 0.0, 100.0};
    TrackConstraintPoint *cp = pTrackConstraintPoint2Regions(track, a, b, point, info, nullptr, info);
    ASSERT_NE(cp, nullptr);
    ASSERT_TRUE(bTrackOptimise(track, 20, 0.001, 0.1, plano_host_interface(tracker.host)));
    EXPECT_EQ(a->status, TRACK_REGION_OK);
    EXPECT_EQ(b->status, TRACK_REGION_OK);
    Plx_Matrix33 ha{}, hb{};
    bTrackMotionRead(a, &ha);
    bTrackMotionRead(b, &hb);
    const Eigen::Vector2d p(cx, cy), truth = apply(seq.truth[1], p);
    const Eigen::Vector2d by_a = apply(from_plx(ha), p), by_b = apply(from_plx(hb), p);
    EXPECT_LT((by_a - truth).norm(), 0.5);
    EXPECT_LT((by_b - truth).norm(), 0.5);
    EXPECT_LT((by_a - by_b).norm(), 0.3);
    // The estimated target, in current-image pixels of the termination level (level 0 here).
    EXPECT_LT((Eigen::Vector2d(cp->target_point[0], cp->target_point[1]) - truth).norm(), 0.5);
    EXPECT_GT(cp->target_information[0], 0.0);
    vTrackFree(track);
}

TEST_F(TrackAccuracy, TexturelessRegionHasTooFewPixels)
{
    const double grey = 0.5;
    Sequence seq;
    seq.frames.push_back(Image(plx_image_form_gen_gl_uc(nullptr, 120, 160)));
    seq.frames.push_back(Image(plx_image_form_gen_gl_uc(nullptr, 120, 160)));
    plx_image_fill_const(seq.frames[0].get(), &grey);
    plx_image_fill_const(seq.frames[1].get(), &grey);
    seq.truth = {Mat3::Identity(), Mat3::Identity()};
    Settings s;
    s.model = TRACK_MODEL_TRANSLATE;
    s.levels = 2;
    s.correlation_size = TRACK_NO_CORRELATION;
    s.texture = 0.02;  // pixels must have some gradient to take part
    std::vector<uint32_t> statuses;
    const std::vector<Eigen::Vector2d> quad = {{50, 40}, {110, 40}, {110, 80}, {50, 80}};
    Tracker(1, s).run(seq, quad, &statuses);
    ASSERT_EQ(statuses.size(), 1u);
    EXPECT_EQ(statuses[0], TRACK_REGION_TOO_FEW_PIXELS);
}

}  // namespace
