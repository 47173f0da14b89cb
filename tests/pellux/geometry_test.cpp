// Homography and affine fits, the incremental least-squares solver and point normalisation.
#include <gtest/gtest.h>

#include <Eigen/Dense>
#include <cmath>
#include <random>
#include <vector>

#include "failure_check.hpp"
#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

Plx_Vector3 apply(const Plx_Matrix33 &H, Plx_Vector3 p)
{
    Plx_Vector3 q;
    plx_mat33_multv3_s(&H, &p, &q);
    return q;
}

// Largest entry difference between a and b after scaling both to unit Frobenius norm and a
// common sign.
double diff_up_to_scale(const Plx_Matrix33 &a, const Plx_Matrix33 &b)
{
    double na = plx_mat33_Fnorm_s(&a), nb = plx_mat33_Fnorm_s(&b), dot = 0;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) dot += a.m[r][c] * b.m[r][c];
    double sign = dot < 0 ? -1 : 1, worst = 0;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) worst = std::max(worst, std::fabs(a.m[r][c] / na - sign * b.m[r][c] / nb));
    return worst;
}

struct HomographyFit {
    Plx_SquMatrix A;
    uint32_t equations = 0;
    HomographyFit()
    {
        EXPECT_NE(plx_squmat_form(&A, PLX_SQUMAT_SYMMETRIC, 9), nullptr);
        plx_squmat_fill_zero(&A);
    }
    ~HomographyFit() { plx_squmat_free(&A); }
    void add(Plx_Vector3 x, Plx_Vector3 xp)
    {
        ASSERT_TRUE(plx_homog33_increment_p(&A, &x, &xp));
        equations += 2;
    }
};

const Plx_Matrix33 kTrueH = {{{1.1, 0.05, 3.0}, {-0.02, 0.95, -1.2}, {0.01, 0.02, 1.0}}};

}  // namespace

TEST(GeometryHomography, RecoversAnExactMapFromFourOrMorePairs)
{
    // Points in pixel-like units and in general position; the map is recovered up to scale
    // whatever the homogeneous scale of each point.
    const Plx_Vector3 pts[] = {{0, 0, 1}, {10, 0.5, 1}, {9.5, 11, 1}, {0.3, 10, 1}, {5, 4, 2}, {-3, 7, 0.5}};
    for (uint32_t n : {4u, 6u}) {
        HomographyFit fit;
        for (uint32_t i = 0; i < n; ++i) {
            Plx_Vector3 q = apply(kTrueH, pts[i]);
            q.x *= 1.7 + i, q.y *= 1.7 + i, q.z *= 1.7 + i;
            fit.add(pts[i], q);
        }
        Plx_Matrix33 H;
        ASSERT_TRUE(plx_homog33_solve(&fit.A, fit.equations, &H));
        EXPECT_NEAR(plx_mat33_Fnorm_s(&H), 1.0, 1e-12);
        EXPECT_LT(diff_up_to_scale(H, kTrueH), 1e-9) << n << " pairs";
        EXPECT_GT(H.m[2][2], 0.0);  // sign fixed: the largest entry is positive
    }
}

TEST(GeometryHomography, NoisyPairsMatchADirectSvdReference)
{
    std::mt19937 rng(7);
    std::normal_distribution<double> noise(0.0, 0.01);
    std::uniform_real_distribution<double> coord(-1.5, 1.5);
    HomographyFit fit;
    Eigen::MatrixXd design(0, 9);
    for (int i = 0; i < 40; ++i) {
        Plx_Vector3 x = {coord(rng), coord(rng), 1};
        Plx_Vector3 q = apply(kTrueH, x);
        q = {q.x / q.z + noise(rng), q.y / q.z + noise(rng), 1};
        fit.add(x, q);
        // Reference: the DLT rows of the same equations, solved by SVD.
        Eigen::Vector3d X(x.x, x.y, x.z);
        design.conservativeResize(design.rows() + 2, 9);
        design.row(design.rows() - 2) << 0, 0, 0, -q.z * X.transpose(), q.y * X.transpose();
        design.row(design.rows() - 1) << q.z * X.transpose(), 0, 0, 0, -q.x * X.transpose();
    }
    Eigen::JacobiSVD<Eigen::MatrixXd> svd(design, Eigen::ComputeFullV);
    Eigen::VectorXd h = svd.matrixV().col(8);
    Plx_Matrix33 ref;
    for (int i = 0; i < 9; ++i) ref.m[i / 3][i % 3] = h(i);
    Plx_Matrix33 H;
    ASSERT_TRUE(plx_homog33_solve(&fit.A, fit.equations, &H));
    EXPECT_LT(diff_up_to_scale(H, ref), 1e-8);
    EXPECT_LT(diff_up_to_scale(H, kTrueH), 0.05);
}

TEST(GeometryHomography, RejectsBadAccumulatorsAndUndeterminedFits)
{
    HomographyFit fit;
    Plx_Matrix33 H = kTrueH;
    // Three collinear points of four leave the map undetermined.
    const Plx_Vector3 line[] = {{0, 0, 1}, {1, 1, 1}, {2, 2, 1}, {0, 3, 1}};
    for (const auto &p : line) fit.add(p, apply(kTrueH, p));
    EXPECT_TRUE(fails_with(plx_homog33_solve(&fit.A, fit.equations, &H), PLX_ERROR_INCOMPATIBLE));
    EXPECT_EQ(H.m[0][0], kTrueH.m[0][0]);  // untouched

    EXPECT_TRUE(fails_with(plx_homog33_solve(&fit.A, 6, &H), PLX_ERROR_NOT_ENOUGH_DATA));

    Plx_SquMatrix wrong;
    ASSERT_NE(plx_squmat_form(&wrong, PLX_SQUMAT_GENERIC, 9), nullptr);
    Plx_Vector3 p = {0, 0, 1};
    EXPECT_TRUE(fails_with(plx_homog33_increment_p(&wrong, &p, &p), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(plx_homog33_solve(&wrong, 8, &H), PLX_ERROR_INCOMPATIBLE));
    plx_squmat_free(&wrong);
    EXPECT_TRUE(fails_with(plx_homog33_increment_p(&fit.A, nullptr, &p), PLX_ERROR_ILLEGAL_ARGUMENT));
}

TEST(GeometryAffine, ExactOnExactDataAndReportsDegenerateSets)
{
    const Plx_Matrix23 truth = {{{0.9, -0.2, 12.0}, {0.3, 1.1, -4.0}}};
    Plx_PseudoInverseSolver *solver = plx_psinv_form(nullptr, 6);
    ASSERT_NE(solver, nullptr);
    const Plx_Vector3 pts[] = {{100, 200, 1}, {340, 210, 1}, {330, 460, 1}, {90, 470, 2}, {500, 20, 1}};
    for (const auto &x : pts) {
        Plx_Vector2 u = {x.x / x.z, x.y / x.z}, v;
        plx_mat23h_multv2_s(&truth, &u, &v);
        Plx_Vector3 xp = {3 * v.x, 3 * v.y, 3};
        ASSERT_TRUE(plx_affine33_increment_p(solver, &x, &xp));
    }
    Plx_Matrix23 A;
    ASSERT_TRUE(plx_affine33_solve(solver, 10, &A));
    for (int r = 0; r < 2; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(A.m[r][c], truth.m[r][c], 1e-9);
    EXPECT_TRUE(fails_with(plx_affine33_solve(solver, 5, &A), PLX_ERROR_NOT_ENOUGH_DATA));

    // Collinear points: the linear part is undetermined.
    plx_psinv_reset(solver);
    for (int i = 0; i < 4; ++i) {
        Plx_Vector3 x = {double(i), 2.0 * i + 1, 1};
        ASSERT_TRUE(plx_affine33_increment_p(solver, &x, &x));
    }
    EXPECT_FALSE(plx_affine33_solve(solver, 8, &A));
    Plx_ErrorRecord rec;
    ASSERT_EQ(plx_err_get_error_count(), 2u);
    ASSERT_TRUE(plx_err_get_error(0, &rec));
    EXPECT_EQ(rec.code, PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_STREQ(rec.function, "plx_psinv_solve");
    ASSERT_TRUE(plx_err_get_error(1, &rec));
    EXPECT_EQ(rec.code, PLX_ERROR_CALLEE);

    Plx_Vector3 inf = {1, 1, 0};
    EXPECT_TRUE(fails_with(plx_affine33_increment_p(solver, &inf, &inf), PLX_ERROR_DIVISION_BY_ZERO));
    plx_psinv_free(solver);

    Plx_PseudoInverseSolver four;
    ASSERT_NE(plx_psinv_form(&four, 4), nullptr);
    EXPECT_TRUE(fails_with(plx_affine33_increment_p(&four, &pts[0], &pts[1]), PLX_ERROR_INCOMPATIBLE));
    plx_psinv_free(&four);
}

TEST(GeometryPseudoInverse, WeightedLeastSquaresMatchesTheNormalEquations)
{
    // Fit y = p0 + p1 t + p2 t^2 with weights; the reference solves the weighted normal
    // equations independently. Unknowns of very different scale must not upset the solve.
    Plx_PseudoInverseSolver s;
    ASSERT_NE(plx_psinv_form(&s, 3), nullptr);
    double p[3];
    EXPECT_TRUE(fails_with(plx_psinv_solve(&s, p), PLX_ERROR_NOT_ENOUGH_DATA));
    Eigen::Matrix<double, 12, 3, Eigen::RowMajor> M;  // rows contiguous, as the solver takes them
    Eigen::VectorXd y(12), w(12);
    for (int i = 0; i < 12; ++i) {
        const double t = 1000.0 + 37.0 * i;
        M.row(i) << 1.0, t, t * t;
        y(i) = 3.0 - 0.5 * t + 1e-3 * t * t + ((i % 3) - 1) * 0.7;
        w(i) = 1.0 + i % 4;
        ASSERT_TRUE(plx_psinv_increment(&s, M.row(i).data(), y(i), w(i)));
    }
    ASSERT_TRUE(plx_psinv_solve(&s, p));
    Eigen::VectorXd sw = w.cwiseSqrt();
    Eigen::VectorXd ref = (sw.asDiagonal() * M).colPivHouseholderQr().solve(sw.asDiagonal() * y);
    for (int i = 0; i < 3; ++i) EXPECT_NEAR(p[i], ref(i), 1e-6 * std::max(1.0, std::fabs(ref(i))));
    EXPECT_EQ(s.equations, 12u);
    plx_psinv_free(&s);

    EXPECT_TRUE(fails_with(plx_psinv_form(nullptr, 0), PLX_ERROR_ILLEGAL_ARGUMENT));
}

TEST(GeometryNormalise, CentresAndScalesToRootTwo)
{
    const Plx_Vector3 pts[] = {{10, 20, 1}, {30, 22, 1}, {26, 50, 2}, {8, 41, 1}, {100, 90, 4}};
    Plx_Vector3 out[5];
    Plx_Matrix33 T;
    ASSERT_TRUE(plx_points_normalise(pts, 5, 1000.0, 1e-15, out, &T));
    double cx = 0, cy = 0, ss = 0;
    for (int i = 0; i < 5; ++i) {
        Plx_Vector3 q = apply(T, pts[i]);
        EXPECT_NEAR(q.x, out[i].x, 1e-12);
        EXPECT_NEAR(q.z, pts[i].z, 0);
        cx += q.x / q.z, cy += q.y / q.z;
    }
    EXPECT_NEAR(cx, 0.0, 1e-12);
    EXPECT_NEAR(cy, 0.0, 1e-12);
    for (int i = 0; i < 5; ++i) ss += std::pow(out[i].x / out[i].z, 2) + std::pow(out[i].y / out[i].z, 2);
    EXPECT_NEAR(std::sqrt(ss / 5), std::sqrt(2.0), 1e-12);

    // A tight cluster hits the scale cap; a single repeated point is rejected.
    const Plx_Vector3 tight[] = {{5, 5, 1}, {5.001, 5, 1}};
    ASSERT_TRUE(plx_points_normalise(tight, 2, 100.0, 1e-15, nullptr, &T));
    EXPECT_EQ(T.m[0][0], 100.0);
    EXPECT_NEAR(T.m[0][2], -500.05, 1e-9);
    const Plx_Vector3 same[] = {{5, 5, 1}, {10, 10, 2}};
    Plx_Matrix33 keep = T;
    EXPECT_TRUE(fails_with(plx_points_normalise(same, 2, 100.0, 1e-15, nullptr, &T), PLX_ERROR_NOT_ENOUGH_DATA));
    EXPECT_EQ(T.m[0][2], keep.m[0][2]);
    const Plx_Vector3 infinite[] = {{5, 5, 1}, {1, 0, 0}};
    EXPECT_TRUE(fails_with(plx_points_normalise(infinite, 2, 100.0, 1e-15, nullptr, &T), PLX_ERROR_NOT_ENOUGH_DATA));
    EXPECT_TRUE(fails_with(plx_points_normalise(pts, 0, 100.0, 1e-15, nullptr, &T), PLX_ERROR_NOT_ENOUGH_DATA));
}

TEST(GeometryNormalise, NormalisedFitUndoneEqualsTheMap)
{
    // The usual pipeline: normalise both sets, fit, undo: H = Tp^-1 Hn Tt.
    const Plx_Vector3 src[] = {{120, 80, 1}, {900, 95, 1}, {880, 700, 1}, {140, 690, 1}};
    Plx_Vector3 dst[4];
    for (int i = 0; i < 4; ++i) dst[i] = apply(kTrueH, src[i]);
    Plx_Vector3 ns[4], nd[4];
    Plx_Matrix33 Tt, Tp, Tpi, Hn, H;
    ASSERT_TRUE(plx_points_normalise(src, 4, 1000, 1e-15, ns, &Tt));
    ASSERT_TRUE(plx_points_normalise(dst, 4, 1000, 1e-15, nd, &Tp));
    HomographyFit fit;
    for (int i = 0; i < 4; ++i) fit.add(ns[i], nd[i]);
    ASSERT_TRUE(plx_homog33_solve(&fit.A, fit.equations, &Hn));
    ASSERT_TRUE(plx_mat33_invert_s(&Tp, &Tpi));
    plx_mat33_rmultm33_s(&Tpi, &Hn, &H);
    plx_mat33_rmultm33_s(&H, &Tt, &H);
    EXPECT_LT(diff_up_to_scale(H, kTrueH), 1e-10);
}
