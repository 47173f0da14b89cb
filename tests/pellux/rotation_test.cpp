// Rotations: quaternion, exponential and matrix forms against closed forms and each other.
#include <gtest/gtest.h>

#include <Eigen/Geometry>
#include <cmath>
#include <random>

#include "failure_check.hpp"
#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

double max_diff(const Plx_Matrix33 &a, const Eigen::Matrix3d &b)
{
    double d = 0;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) d = std::max(d, std::fabs(a.m[r][c] - b(r, c)));
    return d;
}

Eigen::Matrix3d eig(const Plx_Matrix33 &a)
{
    Eigen::Matrix3d e;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) e(r, c) = a.m[r][c];
    return e;
}

}  // namespace

TEST(Rotation, KnownRotationsAboutTheAxes)
{
    // A quarter turn about z takes x to y.
    const double h = std::sqrt(0.5);
    Plx_Quaternion q = {h, 0, 0, h};
    Plx_Matrix33 R;
    ASSERT_TRUE(plx_rot3D_from_quaternion_q(&q, &R));
    Eigen::Matrix3d expect;
    expect << 0, -1, 0, 1, 0, 0, 0, 0, 1;
    EXPECT_LT(max_diff(R, expect), 1e-15);
    Plx_Vector3 w = {0, 0, M_PI / 2};
    ASSERT_TRUE(plx_rot3D_from_exponential_q(&w, &R));
    EXPECT_LT(max_diff(R, expect), 1e-15);
    // The quaternion need not be unit: it is normalised first.
    Plx_Quaternion q3 = {3 * h, 0, 0, 3 * h};
    ASSERT_TRUE(plx_rot3D_from_quaternion_q(&q3, &R));
    EXPECT_LT(max_diff(R, expect), 1e-15);
    // Half a turn about x, through the exponential.
    w = {M_PI, 0, 0};
    ASSERT_TRUE(plx_rot3D_from_exponential_q(&w, &R));
    expect << 1, 0, 0, 0, -1, 0, 0, 0, -1;
    EXPECT_LT(max_diff(R, expect), 1e-15);
}

TEST(Rotation, RoundTripsAgreeWithEigen)
{
    std::mt19937 rng(5);
    std::normal_distribution<double> g(0, 1);
    for (int t = 0; t < 200; ++t) {
        // Angles over the whole range, including near 0 and near pi.
        double angle = t < 10 ? 1e-9 * t : (t < 20 ? M_PI - 1e-9 * (t - 10) : std::fmod(0.1 * t, M_PI));
        Eigen::Vector3d axis(g(rng), g(rng), g(rng));
        axis.normalize();
        Eigen::AngleAxisd aa(angle, axis);
        Eigen::Quaterniond ref(aa);
        Plx_Vector3 w = {angle * axis.x(), angle * axis.y(), angle * axis.z()};
        Plx_Matrix33 R;
        ASSERT_TRUE(plx_rot3D_from_exponential_q(&w, &R));
        EXPECT_LT(max_diff(R, aa.toRotationMatrix()), 1e-14);

        Plx_Quaternion q;
        ASSERT_TRUE(plx_quaternion_from_rot3D(&R, &q));
        EXPECT_GE(q.w, 0.0);
        // q and -q are the same rotation (and at a half turn w = 0 does not pick one).
        double sign = q.w * ref.w() + q.x * ref.x() + q.y * ref.y() + q.z * ref.z() < 0 ? -1 : 1;
        EXPECT_NEAR(q.w, sign * ref.w(), 1e-14);
        EXPECT_NEAR(q.x, sign * ref.x(), 1e-14);
        EXPECT_NEAR(q.z, sign * ref.z(), 1e-14);

        Plx_Vector3 back;
        ASSERT_TRUE(plx_exponential_from_rot3D(&R, &back));
        Plx_Matrix33 R2;
        ASSERT_TRUE(plx_rot3D_from_exponential_q(&back, &R2));
        EXPECT_LT(max_diff(R2, eig(R)), 1e-14);
        if (angle < M_PI - 1e-6) {  // away from a half turn the vector itself is unique
            EXPECT_NEAR(back.x, w.x, 1e-13);
            EXPECT_NEAR(back.y, w.y, 1e-13);
            Plx_Quaternion qe;
            ASSERT_TRUE(plx_quaternion_from_exponential(&w, &qe));
            ASSERT_TRUE(plx_exponential_from_quaternion(&qe, &back));
            EXPECT_NEAR(back.z, w.z, 1e-13);
        }
    }
}

TEST(Rotation, ProductComposesLikeMatrices)
{
    Plx_Vector3 wa = {0.3, -0.2, 0.9}, wb = {-1.1, 0.4, 0.25};
    Plx_Quaternion a, b, ab, inv, id;
    ASSERT_TRUE(plx_quaternion_from_exponential(&wa, &a));
    ASSERT_TRUE(plx_quaternion_from_exponential(&wb, &b));
    ASSERT_TRUE(plx_quaternion_mult(&a, &b, &ab));
    Plx_Matrix33 Ra, Rb, Rab, prod;
    ASSERT_TRUE(plx_rot3D_from_quaternion_q(&a, &Ra));
    ASSERT_TRUE(plx_rot3D_from_quaternion_q(&b, &Rb));
    ASSERT_TRUE(plx_rot3D_from_quaternion_q(&ab, &Rab));
    plx_mat33_rmultm33_s(&Ra, &Rb, &prod);
    EXPECT_LT(max_diff(Rab, eig(prod)), 1e-15);
    ASSERT_TRUE(plx_quaternion_conjugate(&a, &inv));
    ASSERT_TRUE(plx_quaternion_mult(&a, &inv, &id));
    EXPECT_NEAR(id.w, 1.0, 1e-15);
    EXPECT_NEAR(id.x, 0.0, 1e-15);
    ASSERT_TRUE(plx_quaternion_mult(&a, &b, &a));  // output aliasing an input
    EXPECT_EQ(0, std::memcmp(&a, &ab, sizeof a));
}

TEST(Rotation, BadInputsFailWithTheirCodes)
{
    Plx_Quaternion zero = {0, 0, 0, 0}, out = {1, 2, 3, 4};
    Plx_Matrix33 R = {{{7, 7, 7}, {7, 7, 7}, {7, 7, 7}}};
    EXPECT_TRUE(fails_with(plx_rot3D_from_quaternion_q(&zero, &R), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(R.m[0][0], 7.0);
    EXPECT_TRUE(fails_with(plx_quaternion_normalise(&zero, &out), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(out.w, 1.0);
    // A reflection and a scaled rotation are not rotations.
    Plx_Matrix33 reflect = {{{1, 0, 0}, {0, 1, 0}, {0, 0, -1}}}, scaled = {{{2, 0, 0}, {0, 2, 0}, {0, 0, 2}}};
    EXPECT_TRUE(fails_with(plx_quaternion_from_rot3D(&reflect, &out), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(plx_exponential_from_rot3D(&scaled, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    Plx_Vector3 bad = {NAN, 0, 0};
    EXPECT_TRUE(fails_with(plx_rot3D_from_exponential_q(&bad, &R), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_EQ(out.w, 1.0);
}
