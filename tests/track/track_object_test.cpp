// The tracker object: creation and settings, the model order, work estimates and progress,
// the homography information matrix, and the homography conversions between calibrated,
// frame-pixel and window-pixel coordinates with their information matrices.
#include <gtest/gtest.h>

#include <Eigen/Dense>
#include <cmath>
#include <cstring>
#include <random>
#include <vector>

#include "plano/track.h"
#include "track_test_util.hpp"

namespace {

using namespace track_test;

Plx_Camera linear_camera(double zh, double fx, double fy, double x0, double y0)
{
    Plx_Camera camera{};
    EXPECT_TRUE(plx_camera_build_linear(&camera, zh, fx, fy, x0, y0));
    return camera;
}

struct Frames {
    Plx_Image *previous = plx_image_form_gen_gl_uc(nullptr, 32, 32);
    Plx_Image *current = plx_image_form_gen_gl_uc(nullptr, 32, 32);
    ~Frames()
    {
        plx_image_free(previous);
        plx_image_free(current);
    }
};

TEST(TrackObject, NewKeepsBothCamerasAndSettersClampOrDeriveTheirValues)
{
    Frames frames;
    const Plx_Camera a = linear_camera(1, 100, 90, 16, 16), b = linear_camera(1, 110, 95, 15, 17);
    Track *track = pTrackNew(frames.previous, &a, frames.current, &b, 4, nullptr);
    ASSERT_NE(track, nullptr);
    EXPECT_EQ(track->current_camera.fx, 110);  // each frame keeps its own camera
    EXPECT_EQ(track->previous_camera.fx, 100);
    EXPECT_EQ(track->status_range, 1.0);
    vTrackSetTerminationLevel(track, 4);  // at or past the level count: the coarsest level
    EXPECT_EQ(track->termination_level, 3u);
    vTrackSetTerminationLevel(track, 100);
    EXPECT_EQ(track->termination_level, 3u);
    vTrackSetAngleConstraintPosThreshold(track, -3.0);
    EXPECT_EQ(track->angle_pos_threshold_sq, 9.0);
    vTrackSetStatusTimeLimits(track, 0.25, 0.75);
    EXPECT_EQ(track->status_start, 0.25);
    EXPECT_EQ(track->status_range, 0.5);
    vTrackFree(track);
    vTrackFree(nullptr);
}

TEST(TrackObject, NewRefusesMismatchedOrMissingArguments)
{
    Frames frames;
    const Plx_Camera a = linear_camera(1, 100, 100, 0, 0), b = linear_camera(2, 100, 100, 0, 0);
    EXPECT_TRUE(fails_with(pTrackNew(frames.previous, &a, frames.current, &b, 3, nullptr), 32));
    EXPECT_TRUE(fails_with(pTrackNew(nullptr, &a, frames.current, &a, 3, nullptr), 32));
    EXPECT_TRUE(fails_with(pTrackNew(frames.previous, &a, frames.current, &a, 0, nullptr), 32));
}

TEST(TrackModel, MostGeneralFollowsTheGeneralityOrder)
{
    // Rank of generality: translation < trans-scale < trans-rot-scale < affine < projective.
    const uint32_t rank[5] = {3, 4, 0, 2, 1};  // indexed by model value
    for (uint32_t a = 0; a < 5; ++a)
        for (uint32_t b = 0; b < 5; ++b)
            EXPECT_EQ(eMostGeneralTrackingModel(a, b), rank[a] >= rank[b] ? a : b) << a << " " << b;
    EXPECT_EQ(eMostGeneralTrackingModel(5, 1), 0xFFFFFFFFu);
    EXPECT_EQ(origin_code(), 12);
}

TEST(TrackProgress, EstimatesAndPercentages)
{
    EXPECT_DOUBLE_EQ(dTrackEstimateHomogTime(0), 0.6);
    EXPECT_DOUBLE_EQ(dTrackEstimateHomogTime(2), 0.6 / 9);
    EXPECT_EQ(dTrackEstimateCorrTime(nullptr), 0.0);

    struct Log {
        std::vector<int32_t> reports;
    } log;
    auto callback = [](void *context, int32_t percentage) {
        static_cast<Log *>(context)->reports.push_back(percentage);
    };
    StatusTime status{8.0, 0.0};
    vStatusTimeIncrement(&status, 2.0, callback, &log);   // 25 %
    vStatusTimeIncrement(&status, 0.09, callback, &log);  // 26.1 % -> 26
    vStatusTimeIncrement(&status, 100.0, callback, &log); // past the end: held at 99
    vStatusTimeIncrement(&status, -500.0, callback, &log);
    vStatusTimeIncrement(&status, 1.0, nullptr, nullptr);  // no callback: only the sum moves
    EXPECT_EQ(log.reports, (std::vector<int32_t>{25, 26, 99, 0}));
    EXPECT_DOUBLE_EQ(status.done, 2.0 + 0.09 + 100.0 - 500.0 + 1.0);
    StatusTime empty{0.0, 0.0};
    vStatusTimeIncrement(&empty, 1.0, callback, &log);
    EXPECT_EQ(log.reports.back(), 0);
}

Eigen::Matrix<double, 9, 9> dense(const Plx_SquMatrix *m)
{
    Eigen::Matrix<double, 9, 9> d;
    for (uint32_t i = 0; i < 9; ++i)
        for (uint32_t j = 0; j < 9; ++j) d(i, j) = plx_squmat_get(m, i, j);
    return d;
}

TEST(TrackInformation, NullAlongHSymmetricAndPositiveSemiDefinite)
{
    std::mt19937 rng(7);
    std::uniform_real_distribution<double> u(-1.0, 1.0);
    std::vector<Plx_Matrix33> cases;
    cases.push_back(Plx_Matrix33{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}});
    cases.push_back(Plx_Matrix33{{{-1, 0, 5}, {0, -1, 3}, {0, 0, 1}}});  // half turn: negative pivots
    cases.push_back(Plx_Matrix33{{{0, -1, 2}, {1, 0, 1}, {0, 0, -2}}});   // zero pivots, negative H22
    for (int k = 0; k < 20; ++k) {
        Plx_Matrix33 h;
        for (auto &row : h.m)
            for (double &v : row) v = u(rng) * 3;
        cases.push_back(h);
    }
    for (const Plx_Matrix33 &h : cases) {
        Plx_SquMatrix *info = pgsymmatComputeInformationMatrix(&h);
        ASSERT_NE(info, nullptr);
        EXPECT_EQ(info->size, 9u);
        const Eigen::Matrix<double, 9, 9> m = dense(info);
        Eigen::Matrix<double, 9, 1> v;
        for (int i = 0; i < 9; ++i) v(i) = h.m[i / 3][i % 3];
        const double scale = m.norm();
        EXPECT_LT((m * v).norm() / v.norm(), 1e-12 * scale);
        EXPECT_LT((m - m.transpose()).norm(), 1e-12 * scale);
        Eigen::SelfAdjointEigenSolver<Eigen::Matrix<double, 9, 9>> eigen(m);
        EXPECT_GT(eigen.eigenvalues()(0), -1e-10 * scale);
        // Only H's own direction is free: every other direction carries information.
        EXPECT_GT(eigen.eigenvalues()(1), 1e-6 * scale);
        plx_squmat_free(info);
    }
    // The identity, by hand: M = I - h h^T / 3; each pivot k adds 1 to every other diagonal
    // element, -1 at (k, j) for the other pivots j, and 2 at (k, k).
    Plx_Matrix33 identity{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}};
    Plx_SquMatrix *info = pgsymmatComputeInformationMatrix(&identity);
    ASSERT_NE(info, nullptr);
    EXPECT_NEAR(plx_squmat_get(info, 1, 1), 100.0 * (1 + 3), 1e-12);
    EXPECT_NEAR(plx_squmat_get(info, 0, 0), 100.0 * (1 - 1.0 / 3 + 2 + 1 + 1), 1e-12);
    EXPECT_NEAR(plx_squmat_get(info, 0, 4), 100.0 * (-1.0 / 3 - 2), 1e-12);
    plx_squmat_free(info);

    Plx_Matrix33 zero{};
    EXPECT_TRUE(fails_with(pgsymmatComputeInformationMatrix(&zero), 18));
    EXPECT_TRUE(fails_with(pgsymmatComputeInformationMatrix(nullptr), 32));
}

// ---- homography conversions ----

using Mat3 = Eigen::Matrix3d;

Mat3 to_eigen(const Plx_Matrix33 &h)
{
    Mat3 m;
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j) m(i, j) = h.m[i][j];
    return m;
}

Plx_Matrix33 from_eigen(const Mat3 &m)
{
    Plx_Matrix33 h;
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j) h.m[i][j] = m(i, j);
    return h;
}

// The parameters of each model, written out independently of the library.
std::vector<double> params(uint32_t model, const Mat3 &h)
{
    switch (model) {
    case TRACK_MODEL_AFFINE: return {h(0, 0), h(0, 1), h(0, 2), h(1, 0), h(1, 1), h(1, 2)};
    case TRACK_MODEL_PROJ: return {h(0, 0), h(0, 1), h(0, 2), h(1, 0), h(1, 1), h(1, 2), h(2, 0), h(2, 1), h(2, 2)};
    case TRACK_MODEL_TRANSLATE: return {h(0, 2), h(1, 2)};
    case TRACK_MODEL_TRANS_ROT_SCALE:
        return {(h(0, 0) + h(1, 1)) / 2, h(0, 2), (h(1, 0) - h(0, 1)) / 2, h(1, 2)};
    default: return {(h(0, 0) + h(1, 1)) / 2, h(0, 2), h(1, 2)};
    }
}

Mat3 from_params(uint32_t model, const std::vector<double> &p)
{
    Mat3 h = Mat3::Identity();
    switch (model) {
    case TRACK_MODEL_AFFINE: h << p[0], p[1], p[2], p[3], p[4], p[5], 0, 0, 1; break;
    case TRACK_MODEL_PROJ: h << p[0], p[1], p[2], p[3], p[4], p[5], p[6], p[7], p[8]; break;
    case TRACK_MODEL_TRANSLATE: h(0, 2) = p[0], h(1, 2) = p[1]; break;
    case TRACK_MODEL_TRANS_ROT_SCALE: h << p[0], -p[2], p[1], p[2], p[0], p[3], 0, 0, 1; break;
    default: h << p[0], 0, p[1], 0, p[0], p[2], 0, 0, 1; break;
    }
    return h;
}

Mat3 sample_homography(uint32_t model, std::mt19937 &rng)
{
    std::uniform_real_distribution<double> u(-1.0, 1.0);
    const uint32_t n = model == 0 ? 6 : model == 1 ? 9 : model == 2 ? 2 : model == 3 ? 4 : 3;
    std::vector<double> p(n);
    for (double &v : p) v = u(rng) * 0.2;
    if (model == TRACK_MODEL_AFFINE) p[0] += 1, p[4] += 1, p[2] *= 50, p[5] *= 50;
    if (model == TRACK_MODEL_PROJ) p[0] += 1, p[4] += 1, p[8] += 1, p[6] *= 0.01, p[7] *= 0.01;
    if (model == TRACK_MODEL_TRANSLATE) p[0] *= 50, p[1] *= 50;
    if (model == TRACK_MODEL_TRANS_ROT_SCALE) p[0] += 1, p[1] *= 50, p[3] *= 50;
    if (model == TRACK_MODEL_TRANS_SCALE) p[0] += 1, p[1] *= 50, p[2] *= 50;
    return from_params(model, p);
}

// A random symmetric positive definite information matrix of size n.
Plx_SquMatrix *sample_information(uint32_t n, std::mt19937 &rng)
{
    std::uniform_real_distribution<double> u(-1.0, 1.0);
    Eigen::MatrixXd a(n, n);
    for (uint32_t i = 0; i < n; ++i)
        for (uint32_t j = 0; j < n; ++j) a(i, j) = u(rng);
    const Eigen::MatrixXd s = a * a.transpose() + Eigen::MatrixXd::Identity(n, n);
    Plx_SquMatrix *info = plx_squmat_new(PLX_SQUMAT_SYMMETRIC, n);
    std::vector<double> values(s.data(), s.data() + n * n);
    EXPECT_TRUE(plx_squmat_fill(info, values.data()));
    return info;
}

Eigen::MatrixXd dense(const Plx_SquMatrix *m, uint32_t n)
{
    Eigen::MatrixXd d(n, n);
    for (uint32_t i = 0; i < n; ++i)
        for (uint32_t j = 0; j < n; ++j) d(i, j) = plx_squmat_get(m, i, j);
    return d;
}

// J = d p_old / d p_new by central differences, with old_of_new mapping a new H to the old.
template <class F>
Eigen::MatrixXd numeric_jacobian(uint32_t model, const Mat3 &h_new, F old_of_new)
{
    const std::vector<double> p = params(model, h_new);
    const size_t n = p.size();
    Eigen::MatrixXd j(n, n);
    for (size_t c = 0; c < n; ++c) {
        const double eps = 1e-6 * std::max(1.0, std::fabs(p[c]));
        std::vector<double> plus = p, minus = p;
        plus[c] += eps;
        minus[c] -= eps;
        const std::vector<double> a = params(model, old_of_new(from_params(model, plus)));
        const std::vector<double> b = params(model, old_of_new(from_params(model, minus)));
        for (size_t r = 0; r < n; ++r) j(r, c) = (a[r] - b[r]) / (2 * eps);
    }
    return j;
}

Mat3 camera_matrix(const Plx_Camera &c)
{
    Mat3 k;
    k << c.fx, 0, c.x0, 0, c.fy, c.y0, 0, 0, c.zh;
    return k / c.zh;
}

void expect_close(const Eigen::MatrixXd &a, const Eigen::MatrixXd &b, double tol, const char *what)
{
    EXPECT_LT((a - b).norm(), tol * std::max(1.0, b.norm())) << what << "\n" << a << "\n\n" << b;
}

TEST(TrackConversion, CorrectHomographyGivesEachModelItsShape)
{
    const Plx_Matrix33 h{{{4, 1, 6}, {3, 2, 8}, {0.5, 0.25, 2}}};
    struct Case {
        uint32_t model;
        Plx_Matrix33 expected;
        double scale;
    } cases[] = {
        {TRACK_MODEL_AFFINE, {{{2, 0.5, 3}, {1.5, 1, 4}, {0, 0, 1}}}, 2},
        {TRACK_MODEL_PROJ, h, 1},
        {TRACK_MODEL_TRANSLATE, {{{1, 0, 3}, {0, 1, 4}, {0, 0, 1}}}, 2},
        // a = (4 + 2) / 4, b = (3 - 1) / 4
        {TRACK_MODEL_TRANS_ROT_SCALE, {{{1.5, -0.5, 3}, {0.5, 1.5, 4}, {0, 0, 1}}}, 2},
        {TRACK_MODEL_TRANS_SCALE, {{{1.5, 0, 3}, {0, 1.5, 4}, {0, 0, 1}}}, 2},
    };
    for (const Case &c : cases) {
        Plx_Matrix33 m = h;
        double scale = 0;
        ASSERT_TRUE(bCorrectHomography(c.model, &m, &scale));
        EXPECT_EQ(scale, c.scale);
        for (int i = 0; i < 3; ++i)
            for (int j = 0; j < 3; ++j) EXPECT_DOUBLE_EQ(m.m[i][j], c.expected.m[i][j]) << c.model;
    }
    Plx_Matrix33 singular = h;
    singular.m[2][2] = 0;
    EXPECT_TRUE(fails_with(bCorrectHomography(TRACK_MODEL_AFFINE, &singular, nullptr), 18));
    EXPECT_EQ(singular.m[0][0], 4);  // untouched
    EXPECT_TRUE(bCorrectHomography(TRACK_MODEL_PROJ, &singular, nullptr));
    EXPECT_TRUE(fails_with(bCorrectHomography(5, &singular, nullptr), 12));
}

TEST(TrackConversion, CalibrationRoundTripsAndCarriesInformation)
{
    std::mt19937 rng(11);
    for (uint32_t model = 0; model < 5; ++model) {
        const bool reduced = model == TRACK_MODEL_TRANS_ROT_SCALE || model == TRACK_MODEL_TRANS_SCALE;
        // The reduced families survive only cameras with square pixels.
        const Plx_Camera a = linear_camera(2.0, 800, reduced ? 800 : 760, 310, 250);
        TrackRegion region{};
        region.camera = linear_camera(2.0, 700, reduced ? 700 : 690, 330, 236);
        const Mat3 ka = camera_matrix(a), kb = camera_matrix(region.camera);
        const uint32_t n = uint32_t(params(model, Mat3::Identity()).size());
        for (int trial = 0; trial < 3; ++trial) {
            const Mat3 h_pixels = sample_homography(model, rng);
            Plx_Matrix33 h = from_eigen(h_pixels);
            Plx_SquMatrix *info = sample_information(n, rng);
            const Eigen::MatrixXd info_before = dense(info, n);
            ASSERT_TRUE(bTrackApplyCalibToHomography(&h, info, model, &a, &region, 0));
            const Mat3 h_calib = to_eigen(h);
            expect_close(h_calib, ka.inverse() * h_pixels * kb, 1e-12, "to calibrated");
            const Eigen::MatrixXd j = numeric_jacobian(model, h_calib, [&](const Mat3 &x) { return Mat3(ka * x * kb.inverse()); });
            expect_close(dense(info, n), j.transpose() * info_before * j, 1e-7, "information to calibrated");

            ASSERT_TRUE(bTrackApplyCalibToHomography(&h, info, model, &a, &region, 1));
            expect_close(to_eigen(h), h_pixels, 1e-12, "back to pixels");
            // Perspective entries scale by f^2 each way: the round trip loses about 1e-7 there.
            expect_close(dense(info, n), info_before, model == TRACK_MODEL_PROJ ? 1e-5 : 1e-9,
                         "information back to pixels");
            plx_squmat_free(info);
        }
    }
}

TEST(TrackConversion, ReducedModelsKeepTheirShapeThroughUnequalFocalLengths)
{
    const Plx_Camera a = linear_camera(1.0, 800, 700, 0, 0);
    TrackRegion region{};
    region.camera = linear_camera(1.0, 800, 800, 0, 0);
    Plx_Matrix33 h{{{1.0, -0.2, 3}, {0.2, 1.0, 4}, {0, 0, 1}}};
    ASSERT_TRUE(bTrackApplyCalibToHomography(&h, nullptr, TRACK_MODEL_TRANS_ROT_SCALE, &a, &region, 1));
    // K_A H K_B^-1 = [1 -0.2 2400; 0.175 0.875 2800; 0 0 1], then the mean rules.
    EXPECT_NEAR(h.m[0][0], 0.9375, 1e-12);
    EXPECT_NEAR(h.m[1][1], 0.9375, 1e-12);
    EXPECT_NEAR(h.m[1][0], 0.1875, 1e-12);
    EXPECT_NEAR(h.m[0][1], -0.1875, 1e-12);
    EXPECT_NEAR(h.m[0][2], 2400, 1e-9);
    Plx_Matrix33 s{{{1.2, 0, 3}, {0, 1.2, 4}, {0, 0, 1}}};
    ASSERT_TRUE(bTrackApplyCalibToHomography(&s, nullptr, TRACK_MODEL_TRANS_SCALE, &a, &region, 1));
    EXPECT_NEAR(s.m[0][0], 1.125, 1e-12);
    EXPECT_NEAR(s.m[1][1], 1.125, 1e-12);
    EXPECT_EQ(s.m[0][1], 0.0);

    Plx_Matrix33 untouched = h;
    Plx_SquMatrix *wrong = plx_squmat_new(PLX_SQUMAT_SYMMETRIC, 5);
    EXPECT_TRUE(fails_with(bTrackApplyCalibToHomography(&h, wrong, TRACK_MODEL_TRANS_ROT_SCALE, &a, &region, 1), 7));
    EXPECT_EQ(std::memcmp(&h, &untouched, sizeof h), 0);
    EXPECT_TRUE(fails_with(bTrackApplyCalibToHomography(&h, nullptr, 9, &a, &region, 1), 12));
    plx_squmat_free(wrong);
}

TEST(TrackConversion, OffsetsRoundTripAndCarryInformation)
{
    std::mt19937 rng(5);
    const double oa[2] = {120, -35}, ob[2] = {47, 18};
    const double zha = 2.0, zhb = 0.5;
    for (uint32_t model = 0; model < 5; ++model) {
        const uint32_t n = uint32_t(params(model, Mat3::Identity()).size());
        const Mat3 h0 = sample_homography(model, rng);
        Plx_Matrix33 h = from_eigen(h0);
        Plx_SquMatrix *info = sample_information(n, rng);
        const Eigen::MatrixXd info_before = dense(info, n);
        ASSERT_TRUE(bTrackApplyOffsetsToHomography(&h, info, model, oa, zha, ob, zhb, 0));
        Mat3 ta = Mat3::Identity(), tb = Mat3::Identity();
        ta(0, 2) = oa[0] / zha, ta(1, 2) = oa[1] / zha;
        tb(0, 2) = -ob[0] / zhb, tb(1, 2) = -ob[1] / zhb;
        const Mat3 moved = to_eigen(h);
        expect_close(moved, ta * h0 * tb, 1e-12, "forward offsets");
        const Eigen::MatrixXd j =
            numeric_jacobian(model, moved, [&](const Mat3 &x) { return Mat3(ta.inverse() * x * tb.inverse()); });
        expect_close(dense(info, n), j.transpose() * info_before * j, 1e-7, "information forward");
        if (model == TRACK_MODEL_TRANSLATE) expect_close(dense(info, n), info_before, 1e-12, "translation unchanged");
        ASSERT_TRUE(bTrackApplyOffsetsToHomography(&h, info, model, oa, zha, ob, zhb, 1));
        expect_close(to_eigen(h), h0, 1e-12, "offsets back");
        expect_close(dense(info, n), info_before, model == TRACK_MODEL_PROJ ? 1e-6 : 1e-9, "information back");
        plx_squmat_free(info);
    }
    Plx_Matrix33 h{{{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}};
    EXPECT_TRUE(fails_with(bTrackApplyOffsetsToHomography(&h, nullptr, TRACK_MODEL_AFFINE, oa, 0.0, ob, 1.0, 0), 18));
    EXPECT_TRUE(fails_with(bTrackApplyOffsetsToHomography(&h, nullptr, 7, oa, 1.0, ob, 1.0, 0), 12));
    EXPECT_EQ(h.m[0][2], 0.0);
}

}  // namespace
