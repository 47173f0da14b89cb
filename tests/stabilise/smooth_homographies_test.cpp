// Smoothing homographies: anchors kept exactly, the geometric path between anchors with its
// power-of-two exponents, hand-worked smoothing and compression, reference points and
// angles, and failures that leave every caller array as it was.
#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <numbers>
#include <random>
#include <vector>

#include "failure_check.hpp"
#include "plano/plano.h"

namespace {

using plano_test::fails_with;
using Flags = std::vector<int32_t>;  // x, y translation, rotation, scale, shear, aspect, px, py
const Flags kAll(8, 1), kNone(8, 0), kTranslation{1, 1, 0, 0, 0, 0, 0, 0};
constexpr double kDeg = std::numbers::pi / 180;

Plx_Matrix33 shift(double x, double y = 0) { return Plx_Matrix33{{{1, 0, x}, {0, 1, y}, {0, 0, 1}}}; }
Plx_Matrix33 turn(double a, double cx = 0, double cy = 0)
{
    // Rotation by a about (cx, cy).
    const double c = std::cos(a), s = std::sin(a);
    return Plx_Matrix33{{{c, -s, cx - c * cx + s * cy}, {s, c, cy - s * cx - c * cy}, {0, 0, 1}}};
}
double max_diff(const Plx_Matrix33 &a, const Plx_Matrix33 &b)
{
    double d = 0;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) d = std::max(d, std::fabs(a.m[r][c] / a.m[2][2] - b.m[r][c] / b.m[2][2]));
    return d;
}

struct Shot {
    std::vector<uint32_t> anchors;
    std::vector<Plx_Matrix33> in;
    std::vector<Plx_Matrix33> out;
    Plx_Vector3 *points = nullptr;
    double *angles = nullptr;

    bool smooth(const Flags &f, int32_t iterations)
    {
        out.assign(in.size(), shift(-99));
        return bSmoothHomographies(anchors.empty() ? nullptr : anchors.data(), in.data(), points, angles,
                                   static_cast<uint32_t>(in.size()), f[0], f[1], f[2], f[3], f[4], f[5], f[6], f[7],
                                   iterations, out.data());
    }
};

std::vector<Plx_Matrix33> random_shot(std::mt19937 &rng, int n)
{
    std::uniform_real_distribution<double> u(-1, 1);
    std::vector<Plx_Matrix33> h;
    for (int i = 0; i < n; ++i)
        h.push_back(Plx_Matrix33{{{1 + 0.1 * u(rng), 0.1 * u(rng), 20 * u(rng) + i},
                                  {0.1 * u(rng), 1 + 0.1 * u(rng), 20 * u(rng)},
                                  {1e-4 * u(rng), 1e-4 * u(rng), 1}}});
    return h;
}

}  // namespace

TEST(StabiliseSmooth, SizesZeroAndOne)
{
    Plx_Matrix33 in = shift(3), out = shift(-1);
    EXPECT_TRUE(bSmoothHomographies(nullptr, nullptr, nullptr, nullptr, 0, 1, 1, 1, 1, 1, 1, 1, 1, -1, nullptr));
    ASSERT_TRUE(bSmoothHomographies(nullptr, &in, nullptr, nullptr, 1, 1, 1, 1, 1, 1, 1, 1, 1, -1, &out));
    EXPECT_EQ(std::memcmp(&in, &out, sizeof in), 0);
}

TEST(StabiliseSmooth, AnchorsAndTheGeometricPath)
{
    std::mt19937 rng(5);
    Shot r{{1, 0, 0, 1, 0, 0, 0, 0, 1, 0}, random_shot(rng, 10), {}};
    // Everything stabilised: the reference motion, which is the input at the anchors, bit for
    // bit, and with nothing stabilised the input again, whatever the mode.
    ASSERT_TRUE(r.smooth(kAll, -1));
    for (int i : {0, 3, 8}) EXPECT_EQ(std::memcmp(&r.out[i], &r.in[i], sizeof r.in[i]), 0) << i;
    for (int iterations : {-1, 0, 5}) {
        ASSERT_TRUE(r.smooth(kNone, iterations));
        for (int i = 0; i < 10; ++i) EXPECT_LT(max_diff(r.out[i], r.in[i]), 1e-9) << i;
    }

    // A translation ramp over anchors 0 and 10: the root has trunc(log2(10) + 6) = 9 levels,
    // so frame 1 moves by 10 * 51/512, not 1.
    Shot ramp{{1, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1}, {}, {}};
    for (int i = 0; i <= 10; ++i) ramp.in.push_back(shift(i));
    ASSERT_TRUE(ramp.smooth(kTranslation, -1));
    EXPECT_EQ(ramp.out[1].m[0][2], 0.99609375);
    EXPECT_EQ(ramp.out[10].m[0][2], 10);

    // 170 to -170 degrees over anchors 0 and 4 turns through 180.
    Shot spin{{1, 0, 0, 0, 1}, {turn(170 * kDeg), shift(5), shift(5), shift(5), turn(-170 * kDeg)}, {}};
    ASSERT_TRUE(spin.smooth(kAll, -1));
    for (int i : {1, 2, 3}) EXPECT_LT(max_diff(spin.out[i], turn((170 + 5 * i) * kDeg)), 1e-14) << i;
}

TEST(StabiliseSmooth, HandWorkedSmoothingAndCompression)
{
    struct Case {
        std::vector<uint32_t> anchors;
        std::vector<double> x, want;
        int32_t iterations;
    };
    const Case cases[] = {
        // Reference ramp x = i, residual (0, 0, 3, 0, 0); every frame is smoothed from its
        // neighbours' values before the pass.
        {{1, 0, 0, 0, 1}, {0, 1, 5, 3, 4}, {0, 1.75, 3.5, 3.75, 4}, 1},
        // Anchor 2 only: its motion is the reference; frames 1 and 3 are smoothed, then all
        // four are pulled 1% towards the anchor.
        {{0, 0, 1, 0, 0}, {1, 0, 0, 0, 2}, {0.99, 0.2475, 0, 0.495, 1.98}, 1},
        // Full stabilisation without anchors: the mean of all frames.
        {{}, {1, 2, 6, 3}, {3, 3, 3, 3}, -1},
    };
    for (const Case &c : cases) {
        Shot r{c.anchors, {}, {}};
        for (double x : c.x) r.in.push_back(shift(x, 2 * x));
        ASSERT_TRUE(r.smooth(kTranslation, c.iterations));
        for (size_t i = 0; i < c.x.size(); ++i) {
            EXPECT_NEAR(r.out[i].m[0][2], c.want[i], 1e-12) << i;
            EXPECT_NEAR(r.out[i].m[1][2], 2 * c.want[i], 1e-12) << i;
        }
    }
}

TEST(StabiliseSmooth, ReferencePointsAndAngles)
{
    // Frame 1 turns about (50, 20); with that point as the reference, its translation
    // component is the point itself at every frame, so stabilising translation changes
    // nothing. About the origin the turn has a translation, which is removed.
    Shot r{{1, 0, 1}, {shift(0), turn(0.3, 50, 20), shift(0)}, {}};
    std::vector<Plx_Vector3> points{{100, 40, 2}, {0, 0, 0}, {50, 20, 1}};
    std::vector<double> angles{170 * kDeg, 0, -170 * kDeg};
    r.points = points.data();
    r.angles = angles.data();
    ASSERT_TRUE(r.smooth(kTranslation, -1));
    EXPECT_LT(max_diff(r.out[1], r.in[1]), 1e-12);
    EXPECT_NEAR(points[1].x, 50, 1e-12);
    EXPECT_NEAR(points[1].y, 20, 1e-12);
    EXPECT_EQ(points[0].z, 1);
    EXPECT_NEAR(std::fabs(angles[1]), std::numbers::pi, 1e-12);
    r.points = nullptr;
    ASSERT_TRUE(r.smooth(kTranslation, -1));
    EXPECT_GT(max_diff(r.out[1], r.in[1]), 1);
}

TEST(StabiliseSmooth, FailuresLeaveTheCallersArrays)
{
    std::vector<uint32_t> anchors{1, 0, 1};
    std::vector<Plx_Matrix33> in{shift(0), shift(1), shift(2)};
    const Plx_Matrix33 flat{{{1, 0, 1}, {0, 0, 1}, {0, 1, 0}}};  // invertible; its residual has h22 = 0
    Plx_Matrix33 singular{{{1, 1, 0}, {1, 1, 0}, {0, 0, 1}}};
    std::vector<Plx_Vector3> at_infinity{{1, 1, 0}, {0, 0, 1}, {1, 1, 1}};
    struct Case {
        int frame;
        Plx_Matrix33 h;
        Plx_Vector3 *points;
        int32_t iterations, code;
    };
    const Case cases[] = {{1, flat, nullptr, 0, PLX_ERROR_DIVISION_BY_ZERO},
                          {0, singular, nullptr, 0, PLX_ERROR_DIVISION_BY_ZERO},
                          // Half a turn between anchors has no principal square root.
                          {2, Plx_Matrix33{{{-1, 0, 2}, {0, -1, 0}, {0, 0, 1}}}, nullptr, 0, PLX_ERROR_DIVISION_BY_ZERO},
                          {1, shift(1), at_infinity.data(), 0, PLX_ERROR_DIVISION_BY_ZERO},
                          {1, shift(1), nullptr, -2, PLX_ERROR_ILLEGAL_ARGUMENT}};
    for (const Case &c : cases) {
        std::vector<Plx_Matrix33> h = in, out(3, shift(-7));
        h[c.frame] = c.h;
        std::vector<Plx_Vector3> points_before = at_infinity;
        EXPECT_TRUE(fails_with(bSmoothHomographies(anchors.data(), h.data(), c.points, nullptr, 3, 1, 1, 0, 0, 0, 0,
                                                   0, 0, c.iterations, out.data()),
                               c.code));
        for (const Plx_Matrix33 &o : out) EXPECT_EQ(o.m[0][2], -7);
        EXPECT_EQ(std::memcmp(points_before.data(), at_infinity.data(), 3 * sizeof(Plx_Vector3)), 0);
    }
    EXPECT_TRUE(fails_with(bSmoothHomographies(nullptr, nullptr, nullptr, nullptr, 3, 1, 1, 1, 1, 1, 1, 1, 1, -1, in.data()),
                           PLX_ERROR_ILLEGAL_ARGUMENT));
}
