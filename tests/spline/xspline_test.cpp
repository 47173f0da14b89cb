// X-splines: the blending function, positions at and between control points, the rational
// quintic pieces against direct blending, derivatives, widths, normals, edge scales, records
// and failure codes.
#include <cfloat>

#include "failure_check.hpp"
#include "spline_test_util.hpp"

namespace {

using namespace spline_test;
using plano_test::fails_with;

TEST(SplineBlender, ClosedFormsAndDerivativesAgainstFiniteDifferences)
{
    // out(i) is output i of the blender: 0 F, 1 dF/du, 2 dF/dp, 3 d2F/du2, 4 d2F/du dp.
    auto out = [](int i, double p, double u) {
        double d[5];
        d[0] = dXSplineBlender(p, u, &d[1], &d[2], &d[3], &d[4]);
        return d[i];
    };
    const double h = 1e-5;
    for (double p : {2.0, 3.3, 8.0}) {
        EXPECT_EQ(out(0, p, 0.0), 0.0);
        EXPECT_NEAR(out(0, p, 1.0), 1.0, 1e-15);
        for (double u : {-0.4, 0.1, 0.5, 0.93, 1.2}) {
            EXPECT_NEAR(out(0, p, u), F(u, p), 1e-14);
            EXPECT_NEAR(out(1, p, u), (out(0, p, u + h) - out(0, p, u - h)) / (2 * h), 1e-8);
            EXPECT_NEAR(out(2, p, u), (out(0, p + h, u) - out(0, p - h, u)) / (2 * h), 1e-8);
            EXPECT_NEAR(out(3, p, u), (out(1, p, u + h) - out(1, p, u - h)) / (2 * h), 1e-7);
            EXPECT_NEAR(out(4, p, u), (out(2, p, u + h) - out(2, p, u - h)) / (2 * h), 1e-7);
        }
    }
    EXPECT_DOUBLE_EQ(out(0, 8.0, 0.5), 0.25);
}

TEST(SplineXSplineVertex, ControlPointsAndMidpoints)
{
    XSplinePtr c = make_curve({{0, 0, 0.4, 2}, {10, 4, 0.0, 4}, {20, 0, 0.6}, {30, 8}, {15, 30}});
    const XSplineControlPoint *P = c->control_points;
    double v[2], sum;
    ASSERT_TRUE(bXSplineControlPointVertex(&P[0], &P[1], &P[2], v));  // shape 0: the point itself
    EXPECT_EQ(v[0], 10.0);
    EXPECT_EQ(v[1], 4.0);
    c->control_points[1].shape = 1.0;  // shape 1: each neighbour weighs 0.25
    ASSERT_TRUE(bXSplineControlPointVertex(&P[0], &P[1], &P[2], v));
    EXPECT_NEAR(v[0], (10 + 0.25 * 20) / 1.5, 1e-12);
    EXPECT_NEAR(v[1], 4 / 1.5, 1e-12);
    ASSERT_TRUE(bXSplineComputeVertex(&P[0], 8.0, 0.5, &P[1], 2.0, 1.0, &P[2], 8.0, 0.5, nullptr, 0, 0, v, &sum));
    EXPECT_NEAR(v[0], (10 + 0.25 * 20) / 1.5, 1e-12);
    EXPECT_NEAR(sum, 0.25 * 2.0 + 4.0, 1e-12);  // widths weighted, not divided
    EXPECT_TRUE(fails_with(bXSplineComputeVertex(&P[0], 8, 0, &P[1], 8, 0, nullptr, 0, 0, nullptr, 0, 0, v, nullptr),
                           18));

    // Shape pairs taking (P0 P1 P2), (P1 P2 P3), all four, P1 P2 only, and the boundary.
    for (const auto &s : {std::pair{0.8, 0.2}, {0.3, 0.7}, {0.9, 0.9}, {0.2, 0.1}, {0.5, 0.5}}) {
        c->control_points[1].shape = s.first;
        c->control_points[2].shape = s.second;
        ASSERT_TRUE(bXSplineControlPointMidpoint(&P[0], &P[1], &P[2], &P[3], v));
        const std::vector<double> r = reference_point(*c, 1.5 / 5.0);
        EXPECT_NEAR(v[0], r[0], 1e-9) << s.first << " " << s.second;
        EXPECT_NEAR(v[1], r[1], 1e-9) << s.first << " " << s.second;
    }
}

TEST(SplineXSplineVertex, QuinticPiecesMatchDirectBlendingOnRandomCurves)
{
    // One cache serves curves of different sizes in turn: it must follow the curve it is given.
    std::mt19937 rng(7);
    std::uniform_real_distribution<double> unit(0.0, 1.0);
    XSplineControlStruct cache;
    vXSplineInitControlStruct(&cache);
    for (int trial = 0; trial < 12; ++trial) {
        std::vector<Point> points = random_points(rng, 1 + trial * 4);
        if (trial % 3 == 0) points[0].shape = 0.0;
        XSplinePtr curves[2] = {make_curve(points, false), make_curve(points, true)};
        for (int i = 0; i < 120; ++i) {
            const XSpline *c = curves[i % 2].get();
            const double T = i < 109 ? unit(rng) : double(i - 109) / 10.0;  // also span ends and 1
            double v[2];
            ASSERT_TRUE(bXSplineComputeVertexSimple(c, T, v, nullptr, nullptr, nullptr, &cache));
            const std::vector<double> r = reference_point(*c, T);
            EXPECT_NEAR(v[0], r[0], 1e-9) << "n " << c->count << " open " << c->open << " T " << T;
            EXPECT_NEAR(v[1], r[1], 1e-9) << "n " << c->count << " open " << c->open << " T " << T;
        }
    }
    // Moved points are seen once the cache is reinitialised.
    XSplinePtr c = make_curve(random_points(rng, 5));
    double v[2];
    ASSERT_TRUE(bXSplineComputeVertexSimple(c.get(), 0.3, v, nullptr, nullptr, nullptr, &cache));
    c->control_points[1].x += 50.0;
    vXSplineInitControlStruct(&cache);
    ASSERT_TRUE(bXSplineComputeVertexSimple(c.get(), 0.3, v, nullptr, nullptr, nullptr, &cache));
    EXPECT_NEAR(v[0], reference_point(*c, 0.3)[0], 1e-9);
}

TEST(SplineXSplineVertex, StraightRunsStayStraightAndEndsBehave)
{
    XSplinePtr line = make_curve({{0, 0, 0.0}, {3, 1, 0.7}, {9, 3, 1.0}, {12, 4, 0.2}, {21, 7, 0.5}}, true);
    for (double T = 0.0; T <= 1.0; T += 0.01) {
        const Eval e = evaluate(line.get(), T);
        EXPECT_NEAR(e.v[1], e.v[0] / 3.0, 1e-12) << T;
        // No bending, away from the corner at the start and the tail resting on the end.
        const double bend = T > 0.05 && T < 0.75 ? std::hypot(e.second[0], e.second[1]) : 0.0;
        EXPECT_NEAR(bend, 0.0, 1e-9) << T;
    }
    // The open curve starts on its corner and its tail settles on the last point.
    EXPECT_NEAR(evaluate(line.get(), 0.0).v[0], 0.0, 1e-12);
    const Eval end = evaluate(line.get(), 1.0);
    EXPECT_EQ(end.v[0], evaluate(line.get(), 0.99999999).v[0]);
    EXPECT_NEAR(end.v[0], 21.0, 1e-6);
    EXPECT_NEAR(end.v[1], 7.0, 1e-6);
    // A closed curve reads T = 1 as 0.
    std::mt19937 rng(3);
    XSplinePtr closed = make_curve(random_points(rng, 6));
    EXPECT_EQ(evaluate(closed.get(), 0.0).v[1], evaluate(closed.get(), 1.0).v[1]);
}

TEST(SplineXSplineVertex, ContinuityDerivativesAndWidths)
{
    std::mt19937 rng(11);
    std::uniform_real_distribution<double> unit(0.02, 0.98);
    const int n = 7;
    for (bool open : {false, true}) {
        std::vector<Point> points = random_points(rng, n);
        for (Point &p : points) p.shape = std::max(p.shape, 0.05);  // corners have no tangent
        XSplinePtr c = make_curve(points, open);
        // Position and tangent meet across span ends, at the control point's own blend.
        for (int k = 1; k < (open ? n - 1 : n); ++k) {
            const Eval before = evaluate(c.get(), k / double(n) - 1e-12), after = evaluate(c.get(), k / double(n) + 1e-12);
            double v[2];
            const XSplineControlPoint *P = c->control_points;
            ASSERT_TRUE(bXSplineControlPointVertex(&P[k - 1], &P[k], &P[(k + 1) % n], v));
            for (int i = 0; i < 2; ++i) {
                EXPECT_NEAR(before.v[i], after.v[i], 1e-8) << k;
                EXPECT_NEAR(before.tangent[i], after.tangent[i], 1e-6) << k;
                EXPECT_NEAR(after.v[i], v[i], 1e-8) << k;
            }
        }
        // Tangent and curvature vector against central differences, inside spans.
        for (int i = 0; i < 30; ++i) {
            const double T = unit(rng) * (open ? (n - 1.0) / n : 1.0), h = 1e-5;
            if (int((T - h) * n) != int((T + h) * n)) continue;
            const Eval e = evaluate(c.get(), T), a = evaluate(c.get(), T - h), b = evaluate(c.get(), T + h);
            double d1[2], d2[2];
            for (int j = 0; j < 2; ++j) {
                d1[j] = (b.v[j] - a.v[j]) / (2 * h);
                d2[j] = (b.v[j] - 2 * e.v[j] + a.v[j]) / (h * h);
            }
            const double speed2 = d1[0] * d1[0] + d1[1] * d1[1], along = (d1[0] * d2[0] + d1[1] * d2[1]) / speed2;
            const double curvature[2] = {(d2[0] - along * d1[0]) / speed2, (d2[1] - along * d1[1]) / speed2};
            const double scale = std::hypot(curvature[0], curvature[1]) + 1e-3;
            const int k = int(T * n);
            const double w1 = c->control_points[k].edge_width, w2 = c->control_points[(k + 1) % n].edge_width;
            for (int j = 0; j < 2; ++j) {
                EXPECT_NEAR(e.tangent[j], d1[j] / std::sqrt(speed2), 1e-6) << T;
                EXPECT_NEAR(e.second[j], curvature[j], 2e-3 * scale) << T;
            }
            EXPECT_NEAR(e.width, w1 + (T * n - k) * (w2 - w1), 1e-9);  // straight between the points
        }
    }
}

TEST(SplineXSplineQuintic, BernsteinCoefficientsAndSpanPieces)
{
    const double values[] = {3.0, -1.5, 0.25}, slopes[] = {-2.5, 4.0, 1.0}, intercepts[] = {1.0, -0.3, 0.2},
                 p[] = {2.0, 8.0, 5.12};
    double coefficients[6];
    ASSERT_TRUE(bXSplineComputeBernsteinCoefficients(values, slopes, intercepts, p, 3, coefficients));
    // Rows (coefficient, 0, 0, 1) evaluate the plain quintic; so do the extra coefficients.
    double rows[24] = {};
    for (int j = 0; j < 6; ++j) rows[4 * j] = coefficients[j], rows[4 * j + 3] = 1.0;
    for (double tau : {0.0, 0.13, 0.77, 1.0}) {
        double expected = 0.0, v[2], extra = 0.0;
        for (int i = 0; i < 3; ++i) expected += values[i] * F(intercepts[i] + slopes[i] * tau, p[i]);
        ASSERT_TRUE(bXSplineBezierVertex(rows, coefficients, tau, v, nullptr, nullptr, &extra));
        EXPECT_NEAR(v[0], expected, 1e-12 * (1 + std::fabs(expected))) << tau;
        EXPECT_NEAR(extra, expected, 1e-12 * (1 + std::fabs(expected))) << tau;
    }
    double zero[24] = {}, v[2];
    EXPECT_TRUE(fails_with(bXSplineBezierVertex(zero, nullptr, 0.5, v, nullptr, nullptr, nullptr), 18));

    // A span's pieces break where P0 stops reaching in ((1 + s1) L) and where P3 starts
    // ((2 - s2) L), tile [L, 2L], and each is the blended span over its whole range.
    const double L = 0.25;
    struct Case {
        double s1, s2;
        bool nonempty[3];
    } cases[] = {{0.0, 0.0, {false, true, false}}, {1.0, 1.0, {false, true, false}},
                 {0.3, 0.2, {true, true, true}},   {0.6, 0.7, {true, true, true}},
                 {0.5, 0.5, {true, false, true}},  {0.0, 0.4, {false, true, true}}};
    for (const Case &c : cases) {
        XSplinePtr curve = make_curve({{0, 0, 0.5}, {10, 3, c.s1}, {20, -4, c.s2}, {25, 9, 0.5}});
        const XSplineControlPoint *P = curve->control_points;
        XSplineControlStruct cache;
        ASSERT_TRUE(bInitControlStruct(&cache, &P[0], &P[1], &P[2], &P[3], L));
        EXPECT_EQ(cache.span_start, &P[1]);
        EXPECT_EQ(cache.piece_end[2], 2 * L);
        for (int piece = 0; piece < 3; ++piece) {
            EXPECT_EQ(cache.piece_start[piece] < cache.piece_end[piece], c.nonempty[piece]) << c.s1 << " " << piece;
            EXPECT_EQ(cache.piece_start[piece], piece > 0 ? cache.piece_end[piece - 1] : L);
            for (double f : {0.0, 0.5, 1.0}) {
                if (!c.nonempty[piece]) break;
                const double tau = cache.piece_start[piece] + f * (cache.piece_end[piece] - cache.piece_start[piece]);
                ASSERT_TRUE(bXSplineBezierVertex(&cache.coefficients[piece][0][0], nullptr, tau, v, nullptr,
                                                 nullptr, nullptr));
                const std::vector<double> r = reference_point(*curve, tau);  // four points: T is tau
                EXPECT_NEAR(std::hypot(v[0] - r[0], v[1] - r[1]), 0.0, 1e-9) << c.s1 << " " << c.s2 << " " << f;
            }
        }
        EXPECT_TRUE(fails_with(bInitControlStruct(&cache, &P[0], &P[1], &P[2], &P[3], 0.0), 32));
    }
}

TEST(SplineXSplineGeometry, EdgeScalesAndNormals)
{
    const double d20 = 20.0 * M_PI / 180.0;
    const double cases[][5] = {
        {-1, 0, 2, 0, 1.0},                                     // straight through
        {5, 0, 0, 3, std::sqrt(2.0)},                           // right angle
        {1, 0, -0.5, std::sqrt(3.0) / 2, 2.0 / std::sqrt(3.0)},  // 120 degrees
        {1, 0, std::cos(d20), std::sin(d20), 3.0},              // 1 / sin 10 degrees, capped
        {1, 0, 4, 0, 1.0},                                      // both neighbours the same way
        {0, 0, 4, 1, 1.0},                                      // a neighbour on the corner
    };
    for (const auto &c : cases) EXPECT_NEAR(dSplineEdgeScaleFromPoints(0, 0, c[0], c[1], c[2], c[3]), c[4], 1e-12);

    // This square turns from +x towards +y: its normals point out along the diagonals.
    XSplinePtr square = make_curve({{0, 0}, {10, 0}, {10, 10}, {0, 10}});
    const double diagonal[4][2] = {{-1, -1}, {1, -1}, {1, 1}, {-1, 1}};
    for (uint32_t i = 0; i < 4; ++i) {
        ASSERT_TRUE(bXSplineComputeNormal(square.get(), i));
        EXPECT_NEAR(square->control_points[i].normal[0], diagonal[i][0] / std::sqrt(2.0), 1e-12) << i;
        EXPECT_NEAR(square->control_points[i].normal[1], diagonal[i][1] / std::sqrt(2.0), 1e-12) << i;
        EXPECT_NEAR(dXSplineEdgeScale(square.get(), i), std::sqrt(2.0), 1e-7);  // neighbours wrap
    }
    EXPECT_EQ(dXSplineEdgeScale(square.get(), 4), double(FLT_MAX));
    EXPECT_TRUE(fails_with(false, 7));
    EXPECT_TRUE(fails_with(bXSplineComputeNormal(square.get(), 4), 32));
    // One neighbour on the point: the other edge alone; both: some unit direction.
    XSplinePtr degenerate = make_curve({{0, 0}, {0, 0}, {4, 0}});
    ASSERT_TRUE(bXSplineComputeNormal(degenerate.get(), 1));
    EXPECT_NEAR(degenerate->control_points[1].normal[1], -1.0, 1e-15);
    XSplinePtr single = make_curve({{3, 3}});
    ASSERT_TRUE(bXSplineComputeNormal(single.get(), 0));
    EXPECT_NEAR(std::hypot(single->control_points[0].normal[0], single->control_points[0].normal[1]), 1.0, 1e-12);
    XSplinePtr spike = make_curve({{0, 0}, {1, 0}, {5, 0}});  // both neighbours of 0 to the right
    EXPECT_TRUE(fails_with(bXSplineComputeNormal(spike.get(), 0), 18));

    square->open = 1;
    EXPECT_EQ(dXSplineEdgeScale(square.get(), 0), 1.0);
    EXPECT_EQ(dXSplineEdgeScale(square.get(), 3), 1.0);
    EXPECT_TRUE(fails_with(bXSplineComputeNormal(square.get(), 1), 7));
}

TEST(SplineXSplineRecord, RecordsAndBadArguments)
{
    XSplinePtr c(pXSplineAlloc(2));
    EXPECT_EQ(c->open, 0u);
    const double position[2] = {4, -2}, direction[2] = {0, 1};
    ASSERT_TRUE(bXSplineFillControlPoint(&c->control_points[0], position, 0.5, 7, 3.0, 1.0, nullptr));
    ASSERT_TRUE(bXSplineFillControlPointEx(&c->control_points[1], position, 0.0, 7, 3.0, 1.0, direction, 0));
    c->control_points[1].x = 9;
    EXPECT_EQ(c->control_points[0].flag, 1u);
    EXPECT_EQ(c->control_points[0].direction[0], 1.0);
    EXPECT_EQ(c->control_points[1].flag, 0u);
    EXPECT_EQ(c->control_points[1].direction[1], 1.0);
    EXPECT_EQ(pXSplineGetControlPoint(c.get(), 7), &c->control_points[0]);  // the first match
    EXPECT_EQ(pXSplineGetControlPoint(c.get(), 9), nullptr);
    // A refused shape leaves the point as it was.
    EXPECT_TRUE(fails_with(bXSplineFillControlPoint(&c->control_points[1], position, 1.5, 1, 0, 0, nullptr), 32));
    EXPECT_TRUE(fails_with(bXSplineFillControlPoint(&c->control_points[1], position, NAN, 1, 0, 0, nullptr), 32));
    EXPECT_EQ(c->control_points[1].identifier, 7u);

    c->open = 1;
    XSplinePtr copy(pXSplineCopy(c.get()));
    EXPECT_EQ(copy->open, 1u);
    EXPECT_EQ(copy->control_points[1].x, 9.0);
    double lo[2], hi[2];
    ASSERT_TRUE(bXSplineBoundingBox(c.get(), lo, hi));
    EXPECT_EQ(lo[0], 4.0);
    EXPECT_EQ(hi[0], 9.0);
    XSplinePtr empty(pXSplineAlloc(0));
    plx_err_flush_trace();
    EXPECT_FALSE(bXSplineBoundingBox(empty.get(), lo, hi));
    EXPECT_EQ(plx_err_get_error_count(), 0u);
    EXPECT_EQ(hi[1], 0.0);
    for (const auto &s : {std::array{0.4f, 0.5f, 0.0f}, {1.0f, 0.5f, 0.5f}, {1.0f, 1.0f, 0.99999f}, {1.0f, 0.0f, 1e-05f}})
        EXPECT_EQ(fXSplineShowTValues(s[0], s[1]), s[2]);

    XSplineControlStruct cache;
    vXSplineInitControlStruct(&cache);
    double v[2];
    for (double T : {1.5, -1e-9, double(NAN)})
        EXPECT_TRUE(fails_with(bXSplineComputeVertexSimple(c.get(), T, v, nullptr, nullptr, nullptr, &cache), 7));
    EXPECT_TRUE(fails_with(bXSplineComputeVertexSimple(nullptr, 0.5, v, nullptr, nullptr, nullptr, &cache), 32));
    EXPECT_TRUE(fails_with(bXSplineComputeVertexSimple(c.get(), 0.5, v, nullptr, nullptr, nullptr, nullptr), 32));
    EXPECT_TRUE(fails_with(bXSplineComputeVertexSimple(empty.get(), 0.5, v, nullptr, nullptr, nullptr, &cache), 24));
    EXPECT_TRUE(fails_with(pXSplineCopy(nullptr), 32));
}

}  // namespace
