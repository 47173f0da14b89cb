// Anchor-frame lists, homography components and matrix roots: known answers, round trips on
// random homographies, the power table of the general root, and the failure codes.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <numbers>
#include <random>
#include <string>
#include <vector>

#include "failure_check.hpp"
#include "plano/plano.h"

namespace {

using plano_test::fails_with;
constexpr double kPi = std::numbers::pi;

Plx_Matrix33 rotation33(double a)
{
    return Plx_Matrix33{{{std::cos(a), -std::sin(a), 0}, {std::sin(a), std::cos(a), 0}, {0, 0, 1}}};
}
double max_diff(const Plx_Matrix33 &a, const Plx_Matrix33 &b)
{
    double d = 0;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) d = std::max(d, std::fabs(a.m[r][c] - b.m[r][c]));
    return d;
}

}  // namespace

TEST(StabiliseFrameList, TextsAndTheirFailures)
{
    struct Case {
        const char *text;
        std::vector<uint32_t> listed;  // frames of 1..10 set
        int32_t code;                  // 0: success
    };
    const Case cases[] = {{"3,5;7", {3, 5, 7}, 0}, {"", {}, 0},       {"1,10", {1, 10}, 0},   {"3,3", {3}, 0},
                          {"3,12", {}, 7},         {"3,", {}, 7},     {",3", {}, 7},          {"3 5", {}, 7},
                          {"0", {}, 7},            {"3;;5", {}, 7},   {"x", {}, 7},           {"-3", {}, 7},
                          {"00000000000000000003", {3}, 0},           {"000000000000000000003", {}, 7},
                          {"99999999999999999999", {}, 7}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.text);
        std::vector<uint32_t> mine(10, 9);
        uint32_t *given = abParseStringOfFrames(1, 10, c.text, mine.data());
        uint32_t *made = abParseStringOfFrames(1, 10, c.text, nullptr);
        if (c.code != 0) {
            EXPECT_TRUE(fails_with(made, c.code));
            EXPECT_TRUE(fails_with(given, c.code));
            EXPECT_EQ(mine, std::vector<uint32_t>(10, 9)) << "a failed parse must leave the caller's flags";
            continue;
        }
        ASSERT_NE(made, nullptr);
        EXPECT_EQ(given, mine.data());
        std::vector<uint32_t> want(10, 0);
        for (uint32_t f : c.listed) want[f - 1] = 1;
        EXPECT_EQ(std::vector<uint32_t>(made, made + 10), want);
        EXPECT_EQ(mine, want);
        std::free(made);
    }
    EXPECT_TRUE(fails_with(abParseStringOfFrames(5, 4, "", nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(abParseStringOfFrames(1, 4, nullptr, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
}

TEST(StabiliseComponents, KnownAnswersAndRoundTrips)
{
    // A similarity: rotation, scale and translation come out as such.
    const double a = 0.7, s = 1.5;
    Plx_Matrix33 H{{{s * std::cos(a), -s * std::sin(a), 3}, {s * std::sin(a), s * std::cos(a), -4}, {0, 0, 1}}};
    HomographyComponents c;
    ASSERT_TRUE(bDecomposeHomography(&H, 0.0, &c));
    const double want[8] = {a, 3, -4, s, 0, 1, 0, 0};
    for (int i = 0; i < 8; ++i) EXPECT_NEAR(c.c[i], want[i], 1e-14) << i;

    // A stretch by k along direction d is measured along d as scale k, aspect 1/k.
    const double d = 0.4, k = 2.0;
    const double cd = std::cos(d), sd = std::sin(d);
    Plx_Matrix33 S{{{1 + (k - 1) * cd * cd, (k - 1) * cd * sd, 0}, {(k - 1) * cd * sd, 1 + (k - 1) * sd * sd, 0}, {0, 0, 1}}};
    ASSERT_TRUE(bDecomposeHomography(&S, d, &c));
    EXPECT_NEAR(c.c[PLANO_COMPONENT_ROTATION], 0, 1e-14);
    EXPECT_NEAR(c.c[PLANO_COMPONENT_SCALE], k, 1e-14);
    EXPECT_NEAR(c.c[PLANO_COMPONENT_SHEAR], 0, 1e-14);
    EXPECT_NEAR(c.c[PLANO_COMPONENT_ASPECT], 1 / k, 1e-14);

    std::mt19937 rng(17);
    std::uniform_real_distribution<double> u(-1, 1);
    for (int trial = 0; trial < 1000; ++trial) {
        Plx_Matrix33 G{{{1 + 0.5 * u(rng), 0.5 * u(rng), 100 * u(rng)},
                        {0.5 * u(rng), 1 + 0.5 * u(rng), 100 * u(rng)},
                        {1e-3 * u(rng), 1e-3 * u(rng), 1 + 0.5 * u(rng)}}};
        const double angle = kPi * u(rng);
        Plx_Matrix33 back;
        ASSERT_TRUE(bDecomposeHomography(&G, angle, &c));
        ASSERT_TRUE(bReconstructHomography(&c, angle, &back));
        for (int r = 0; r < 3; ++r)
            for (int col = 0; col < 3; ++col)
                EXPECT_NEAR(back.m[r][col], G.m[r][col] / G.m[2][2], 1e-12 * std::max(1.0, std::fabs(G.m[r][col] / G.m[2][2])));
    }

    Plx_Matrix33 flat = H;
    flat.m[2][2] = 0;
    EXPECT_TRUE(fails_with(bDecomposeHomography(&flat, 0, &c), PLX_ERROR_DIVISION_BY_ZERO));
    Plx_Matrix33 column{{{0, 1, 0}, {0, 1, 0}, {0, 0, 1}}};
    EXPECT_TRUE(fails_with(bDecomposeHomography(&column, 0, &c), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_TRUE(fails_with(bDecomposeHomography(nullptr, 0, &c), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bReconstructHomography(&c, 0, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
}

TEST(StabiliseComponents, InterpolationByKind)
{
    // 170 degrees to -170 degrees passes through 180, not 0; scale goes geometrically.
    const double deg = kPi / 180;
    HomographyComponents a{{170 * deg, 0, 10, 1, 2, 1, 0, 0}}, b{{-170 * deg, 4, 20, 4, 4, 3, 1, 1}}, out = a;
    ASSERT_TRUE(bInterpolateComponents(&out, &a, &b, 0.25, 255));
    const double want[8] = {175 * deg, 1, 12.5, std::sqrt(2.0), 2.5, 1.5, 0.25, 0.25};
    for (int i = 0; i < 8; ++i) EXPECT_NEAR(out.c[i], want[i], 1e-14) << i;
    out = a;
    ASSERT_TRUE(bInterpolateComponents(&out, &a, &b, 0.5, PLANO_MASK_ROTATION | PLANO_MASK_Y_TRANSLATION));
    EXPECT_NEAR(std::fabs(out.c[PLANO_COMPONENT_ROTATION]), kPi, 1e-14);
    EXPECT_EQ(out.c[PLANO_COMPONENT_Y_TRANSLATION], 15);
    EXPECT_EQ(out.c[PLANO_COMPONENT_SCALE], 1) << "an unmasked component is left alone";
}

TEST(StabiliseRoots, SquareRoots)
{
    // sqrt of a rotation by 2a is the rotation by a; of a translation, half the translation;
    // of a general matrix, whatever squares back to it.
    const Plx_Matrix33 shifted{{{1, 0, 10}, {0, 1, -6}, {0, 0, 1}}}, half{{{1, 0, 5}, {0, 1, -3}, {0, 0, 1}}};
    const Plx_Matrix33 general{{{4, 1, 3}, {0.5, 9, 2}, {1e-3, 0, 1}}}, half_turn = rotation33(0.6);
    const struct {
        Plx_Matrix33 A;
        const Plx_Matrix33 *root;
    } cases[] = {{rotation33(1.2), &half_turn}, {shifted, &half}, {general, nullptr}};
    for (const auto &c : cases) {
        Plx_Matrix33 X, XX;
        ASSERT_TRUE(bMatrix33SquareRoot(&c.A, &X));
        plx_mat33_rmultm33_s(&X, &X, &XX);
        EXPECT_LT(max_diff(XX, c.A), 1e-11);
        if (c.root != nullptr) {
            EXPECT_LT(max_diff(X, *c.root), 1e-14);
        }
    }
    Plx_Matrix33 X;
    Plx_Matrix22 A22{{{4, 1}, {2, 3}}}, X22, XX22;
    ASSERT_TRUE(bMatrix22SquareRoot(&A22, &X22));
    plx_mat22_rmultm22_s(&X22, &X22, &XX22);
    for (int i = 0; i < 4; ++i) EXPECT_NEAR(XX22.m[i / 2][i % 2], A22.m[i / 2][i % 2], 1e-11);

    // Symmetric: [[1,1],[1,1]] squares to twice itself, so its root is itself over sqrt 2.
    Plx_Matrix22 sym{{{1, 1}, {1, 1}}}, root;
    ASSERT_TRUE(bSymMatrix22SquareRoot(&sym, &root));
    for (int i = 0; i < 4; ++i) EXPECT_NEAR(root.m[i / 2][i % 2], 1 / std::sqrt(2.0), 1e-14);

    // -I: the first update lands on zero; diag(-4, 1) has no real root and wanders.
    Plx_Matrix22 minus{{{-1, 0}, {0, -1}}}, wander{{{-4, 0}, {0, 1}}}, indefinite{{{1, 2}, {2, 1}}};
    EXPECT_TRUE(fails_with(bMatrix22SquareRoot(&minus, &X22), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(plx_err_get_error_count(), 2u) << "the square root adds code 1 to the inverse's record";
    EXPECT_TRUE(fails_with(bMatrix22SquareRoot(&wander, &X22), PLX_ERROR_NO_CONVERGENCE));
    EXPECT_TRUE(fails_with(bSymMatrix22SquareRoot(&indefinite, &X22), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bMatrix33SquareRoot(nullptr, &X), PLX_ERROR_ILLEGAL_ARGUMENT));
}

TEST(StabiliseRoots, GeneralRootPowerTable)
{
    const Plx_Matrix33 M = rotation33(1.0);
    Matrix33GeneralRoot g{};
    ASSERT_TRUE(bMatrix33GeneralRootInit(&M, 6, &g));
    auto computed = [&] {
        std::vector<uint32_t> j;
        for (uint32_t i = 0; i <= 64; ++i)
            if (g.computed[i]) j.push_back(i);
        return j;
    };
    EXPECT_EQ(computed(), (std::vector<uint32_t>{0, 64}));

    // t = 0.5 is power 32 of 64: the chain's entry L-1, the plain square root.
    Plx_Matrix33 P, sqrtM;
    ASSERT_TRUE(bMatrix33GeneralRoot(&g, 0.5, &P));
    ASSERT_TRUE(bMatrix33SquareRoot(&M, &sqrtM));
    EXPECT_EQ(max_diff(P, sqrtM), 0.0);
    EXPECT_EQ(computed(), (std::vector<uint32_t>{0, 32, 64}));
    // 0.3 rounds to 19/64 = 16 + 2 + 1: made from 18 and 16 on the way.
    ASSERT_TRUE(bMatrix33GeneralRoot(&g, 0.3, &P));
    EXPECT_LT(max_diff(P, rotation33(19.0 / 64)), 1e-13);
    EXPECT_EQ(computed(), (std::vector<uint32_t>{0, 16, 18, 19, 32, 64}));
    // Beyond 1, squares of the power for t / 2.
    ASSERT_TRUE(bMatrix33GeneralRoot(&g, 2.5, &P));
    EXPECT_LT(max_diff(P, rotation33(2.5)), 1e-13);
    ASSERT_TRUE(bMatrix33GeneralRoot(&g, 0.0, &P));
    EXPECT_EQ(max_diff(P, rotation33(0)), 0.0);

    EXPECT_TRUE(fails_with(bMatrix33GeneralRoot(&g, -0.1, &P), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bMatrix33GeneralRoot(&g, NAN, &P), PLX_ERROR_ILLEGAL_ARGUMENT));
    vMatrix33GeneralRootFree(&g);
    EXPECT_EQ(g.root, nullptr);
    EXPECT_TRUE(fails_with(bMatrix33GeneralRoot(&g, 0.5, &P), PLX_ERROR_NOT_INITIALISED));
    // A chain that cannot be made leaves an empty record behind (and nothing to leak).
    const Plx_Matrix33 minus{{{-1, 0, 0}, {0, -1, 0}, {0, 0, 1}}};
    EXPECT_TRUE(fails_with(bMatrix33GeneralRootInit(&minus, 3, &g), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(g.power, nullptr);
    EXPECT_TRUE(fails_with(bMatrix33GeneralRootInit(&M, 25, &g), PLX_ERROR_ILLEGAL_ARGUMENT));
}
