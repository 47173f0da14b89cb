// Bezier curves: spans and curves against the cubic's control-point form, turning back,
// boxes, normals, edge scales, and the conversion from X-splines.
#include <cfloat>

#include "failure_check.hpp"
#include "spline_test_util.hpp"

namespace {

using namespace spline_test;
using plano_test::fails_with;

using V = std::array<double, 2>;
V xy(double x, double y) { return {x, y}; }

BezierCurveSpan span_of(V start, V end, V h0, V h1)
{
    BezierCurveSpan s{};
    EXPECT_TRUE(bBezierCurveFillSpan(&s, start.data(), end.data(), h0.data(), h1.data(), 1, 2));
    return s;
}

// A curve of spans chained through the points, handles a fraction of each chord.
BezierPtr chain(const std::vector<V> &points, double handle, bool open = false)
{
    const uint32_t n = uint32_t(points.size()) - (open ? 1 : 0);
    BezierPtr c(pBezierCurveAlloc(n));
    c->open = open ? 1u : 0u;
    for (uint32_t i = 0; i < n; ++i) {
        const V &a = points[i], &b = points[(i + 1) % points.size()];
        const V d = {handle * (b[0] - a[0]), handle * (b[1] - a[1])};
        c->spans[i] = span_of(a, b, d, {-d[0], -d[1]});
    }
    return c;
}

TEST(SplineBezierSpan, CubicOfItsControlPointsAndTurningBack)
{
    const BezierCurveSpan s = span_of({1, 2}, {9, -3}, {4, 5}, {-2, 6});
    const double P[4][2] = {{1, 2}, {5, 7}, {7, 3}, {9, -3}};
    for (double t : {0.0, 0.2, 0.5, 0.9, 1.0}) {
        const double b[4] = {std::pow(1 - t, 3), 3 * t * (1 - t) * (1 - t), 3 * t * t * (1 - t), t * t * t};
        double p[2], d[2], pa[2], pb[2];
        vBezierSpanComputeVertex(&s, t, p, d);
        vBezierSpanComputeVertex(&s, t - 1e-6, pa, nullptr);
        vBezierSpanComputeVertex(&s, t + 1e-6, pb, nullptr);
        for (int i = 0; i < 2; ++i) {
            EXPECT_NEAR(p[i], b[0] * P[0][i] + b[1] * P[1][i] + b[2] * P[2][i] + b[3] * P[3][i], 1e-12) << t;
            EXPECT_NEAR(d[i], (pb[i] - pa[i]) / 2e-6, 1e-7) << t;
        }
    }
    double m[2], d[2];
    ASSERT_TRUE(bBezierCurveSpanMidpoint(&s, m));
    EXPECT_NEAR(m[0], (P[0][0] + 3 * P[1][0] + 3 * P[2][0] + P[3][0]) / 8, 1e-12);
    // Without handles: the straight segment, at rest at both ends.
    const BezierCurveSpan line = span_of({0, 0}, {10, 20}, {0, 0}, {0, 0});
    vBezierSpanComputeVertex(&line, 0.3, m, d);
    EXPECT_NEAR(m[1], 20 * (3 * 0.09 - 2 * 0.027), 1e-12);
    vBezierSpanComputeVertex(&line, 1.0, m, d);
    EXPECT_EQ(std::hypot(d[0], d[1]), 0.0);

    struct Case {
        V h0, h1;
        Plx_Bool backwards;
        double end = 30;
    } cases[] = {
        {{30, 0}, {30, 0}, 1},  // x runs past the end and back, then on: an S
        {{3, 5}, {-3, 5}, 0},   // always forwards
        {{0, 5}, {0, 5}, 0},    // stops only at the ends
        {{-5, 0}, {-5, 0}, 1},  // starts backwards
        // Quadratics in x (no cubic term), whose x derivative is linear:
        {{3, 0}, {-1, 0}, 0, 6},  // slowing down, never stopping
        {{8, 0}, {4, 0}, 1, 6},   // overshooting the end
    };
    for (const Case &c : cases) {
        const BezierCurveSpan b = span_of({0, 0}, {c.end, 0}, c.h0, c.h1);
        EXPECT_EQ(bBezierCurveSpanComputeBackwards(&b), c.backwards) << c.h0[0] << " " << c.h1[0];
    }
}

TEST(SplineBezierCurve, EvaluationBoxesAndRecords)
{
    BezierPtr c = chain({{0, 0}, {10, 0}, {10, 10}, {0, 10}}, 0.3);
    double p[2], q[2];
    ASSERT_TRUE(bBezierCurveComputeVertex(c.get(), 1.0, p, nullptr));  // the last end: the first start
    EXPECT_EQ(p[0], 0.0);
    EXPECT_EQ(p[1], 0.0);
    ASSERT_TRUE(bBezierCurveComputeVertex(c.get(), 0.375, p, nullptr));  // span 1 at t = 0.5
    vBezierSpanComputeVertex(&c->spans[1], 0.5, q, nullptr);
    EXPECT_EQ(p[0], q[0]);
    ASSERT_TRUE(bBezierCurveComputeVertex(c.get(), std::nextafter(1.0, 0.0), p, nullptr));
    EXPECT_NEAR(p[1], 0.0, 1e-12);
    EXPECT_TRUE(fails_with(bBezierCurveComputeVertex(c.get(), 1.01, p, nullptr), 7));
    EXPECT_TRUE(fails_with(bBezierCurveComputeVertex(c.get(), NAN, p, nullptr), 7));
    BezierPtr empty(pBezierCurveAlloc(0));
    EXPECT_TRUE(fails_with(bBezierCurveComputeVertex(empty.get(), 0.5, p, nullptr), 24));

    const BezierCurveSpan s = span_of({0, 0}, {10, 2}, {1, 7}, {-1, -4});
    double A[2], B[2], lo[2], hi[2];
    vBezierCurveSpanBoundingBoxLimitedTangents(&s, A, B);
    EXPECT_EQ(xy(A[0], A[1]), xy(0, 7));
    EXPECT_EQ(xy(B[0], B[1]), xy(10, -2));
    BezierPtr open = chain({{0, 0}, {10, 0}, {10, 20}}, 0.5, true);
    open->spans[1].end_handle[0] = 5;  // a handle tip outside the ends
    ASSERT_TRUE(bBezierCurveBoundingBox(open.get(), lo, hi, 0));
    EXPECT_EQ(xy(hi[0], hi[1]), xy(10, 20));
    ASSERT_TRUE(bBezierCurveBoundingBox(open.get(), lo, hi, 1));
    EXPECT_EQ(hi[0], 15.0);
    ASSERT_TRUE(bBezierCurveCentre(open.get(), p));
    EXPECT_EQ(xy(p[0], p[1]), xy(5, 10));
    plx_err_flush_trace();
    EXPECT_FALSE(bBezierCurveCentre(empty.get(), p));
    EXPECT_EQ(plx_err_get_error_count(), 0u);
    EXPECT_EQ(p[0], 0.0);

    // Allocation flags both ends; filling leaves the flags; copies keep the open flag.
    BezierPtr fresh(pBezierCurveAlloc(1));
    EXPECT_EQ(fresh->spans[0].start_flag + fresh->spans[0].end_flag, 2u);
    fresh->spans[0].end_flag = 0;
    const double a[2] = {1, 2}, b[2] = {3, 4}, h0[2] = {5, 6}, h1[2] = {7, 8};
    ASSERT_TRUE(bBezierCurveFillSpan(fresh->spans, a, b, h0, h1, 1, 2));
    EXPECT_EQ(fresh->spans[0].start_flag, 1u);
    EXPECT_EQ(fresh->spans[0].end_flag, 0u);
    fresh->open = 1;
    BezierPtr copy(pBezierCurveCopy(fresh.get()));
    EXPECT_EQ(copy->open, 1u);
    EXPECT_EQ(copy->spans[0].end_handle[1], 8.0);
    EXPECT_EQ(copy->spans[0].end_identifier, 2u);
    EXPECT_TRUE(fails_with(pBezierCurveCopy(nullptr), 32));
}

TEST(SplineBezierCurve, NormalsAndEdgeScales)
{
    // A square of straight spans: the normals point out along the diagonals, as for X-splines.
    BezierPtr square = chain({{0, 0}, {10, 0}, {10, 10}, {0, 10}}, 0.25);
    const double diagonal[4][2] = {{-1, -1}, {1, -1}, {1, 1}, {-1, 1}};
    double n[2];
    for (uint32_t i = 0; i < 4; ++i) {
        ASSERT_TRUE(bBezierComputeNormal(square.get(), i, n));
        EXPECT_NEAR(n[0], diagonal[i][0] / std::sqrt(2.0), 1e-12) << i;
        EXPECT_NEAR(n[1], diagonal[i][1] / std::sqrt(2.0), 1e-12) << i;
        EXPECT_NEAR(dBezierEdgeScale(square.get(), i), std::sqrt(2.0), 1e-7);
    }
    EXPECT_TRUE(fails_with(bBezierComputeNormal(square.get(), 4, n), 32));
    BezierPtr empty(pBezierCurveAlloc(0));
    empty->open = 1;
    EXPECT_TRUE(fails_with(bBezierComputeNormal(empty.get(), 0, n), 24));
    EXPECT_EQ(dBezierEdgeScale(square.get(), 4), double(FLT_MAX));
    EXPECT_TRUE(fails_with(false, 7));
    // A handle under a tenth of its chord gives way to the chord.
    square->spans[0].start_handle[0] = 0.5;
    square->spans[0].start_handle[1] = 0.8;
    ASSERT_TRUE(bBezierComputeNormal(square.get(), 0, n));
    EXPECT_NEAR(n[0], -1 / std::sqrt(2.0), 1e-12);

    // An open run of two spans, its end included, is normal to its line.
    BezierPtr open = chain({{0, 0}, {10, 0}, {20, 0}}, 0.3, true);
    for (uint32_t i = 0; i <= 2; ++i) {
        ASSERT_TRUE(bBezierComputeNormal(open.get(), i, n));
        EXPECT_NEAR(n[1], -1.0, 1e-12) << i;
    }
    EXPECT_EQ(dBezierEdgeScale(open.get(), 0), 1.0);
    EXPECT_EQ(dBezierEdgeScale(open.get(), 1), 1.0);
    // A cusp, where the directions cancel, still gets a unit normal.
    BezierPtr cusp(pBezierCurveAlloc(2));
    cusp->spans[0] = span_of({0, 0}, {10, 0}, {3, 0}, {-3, 0});
    cusp->spans[1] = span_of({10, 0}, {0, 0}, {3, 0}, {3, 0});
    ASSERT_TRUE(bBezierComputeNormal(cusp.get(), 1, n));
    EXPECT_NEAR(std::hypot(n[0], n[1]), 1.0, 1e-12);
}

// Closest distance from p to the X-spline between T0 and T1, by dense sampling.
double distance_to_curve(const XSpline *c, const double p[2], double T0, double T1)
{
    double best = 1e300;
    for (int i = 0; i <= 2000; ++i) {
        const Eval e = evaluate(c, T0 + (T1 - T0) * i / 2000.0);
        best = std::min(best, std::hypot(e.v[0] - p[0], e.v[1] - p[1]));
    }
    return best;
}

TEST(SplineBezierFromXSpline, SpansMeetTheCurveAndFollowIt)
{
    std::mt19937 rng(21);
    for (int m : {1, 2, 3}) {
        std::vector<Point> points = random_points(rng, 5);
        for (Point &p : points) p.shape = 0.4 + 0.6 * p.shape;
        points[2].shape = 0.0;  // one corner, starting span 2m
        XSplinePtr x = make_curve(points);
        BezierPtr b(pBezierCurveFromXSpline(x.get(), m));
        ASSERT_NE(b, nullptr);
        ASSERT_EQ(b->count, uint32_t(5 * m));
        for (uint32_t k = 0; k < b->count; ++k) {
            const BezierCurveSpan &s = b->spans[k], &next = b->spans[(k + 1) % b->count];
            const double T0 = double(k) / b->count, T1 = double(k + 1) / b->count;
            const Eval e0 = evaluate(x.get(), T0), e1 = evaluate(x.get(), T1), middle = evaluate(x.get(), 0.5 * (T0 + T1));
            const bool at_corner = k == uint32_t(2 * m) || k + 1 == uint32_t(2 * m);
            double p[2];
            vBezierSpanComputeVertex(&s, 0.5, p, nullptr);
            EXPECT_NEAR(std::hypot(s.start_x - e0.v[0], s.start_y - e0.v[1]), 0.0, 1e-9) << m << " " << k;
            EXPECT_NEAR(std::hypot(s.end_x - e1.v[0], s.end_y - e1.v[1]), 0.0, 1e-9) << m << " " << k;
            EXPECT_EQ(xy(s.end_x, s.end_y), xy(next.start_x, next.start_y));
            EXPECT_EQ(s.start_identifier, 100u + k / m);
            if (!at_corner) {
                // Along the curve's tangent, and through its middle point (at a corner the
                // curve leaves at rest and the handles may fall back to a quarter chord).
                const double h = std::hypot(s.start_handle[0], s.start_handle[1]);
                EXPECT_NEAR(s.start_handle[0] / h, e0.tangent[0], 1e-9);
                EXPECT_NEAR(s.start_handle[1] / h, e0.tangent[1], 1e-9);
                EXPECT_NEAR(std::hypot(p[0] - middle.v[0], p[1] - middle.v[1]), 0.0, 1e-9) << m << " " << k;
            }
            const double tolerance[] = {0.0, 2.0, 0.25, 0.1};
            for (double t : {0.25, 0.75}) {
                vBezierSpanComputeVertex(&s, t, p, nullptr);
                EXPECT_LT(distance_to_curve(x.get(), p, T0, T1), tolerance[m]) << m << " " << k << " " << t;
            }
        }
        EXPECT_EQ(xy(b->spans[2 * m].start_x, b->spans[2 * m].start_y), xy(points[2].x, points[2].y));
        EXPECT_EQ(b->spans[2 * m - 1].end_identifier, 102u);

        // Scaling the X-spline scales its Bezier curve, handles included (also those at the
        // corner, where the lengths fall back to a quarter of the chord).
        for (Point &p : points) p.x *= 8.0, p.y *= 8.0;
        XSplinePtr scaled = make_curve(points);
        BezierPtr big(pBezierCurveFromXSpline(scaled.get(), m));
        for (uint32_t k = 0; k < b->count; ++k) {
            for (int i = 0; i < 2; ++i) {
                EXPECT_NEAR(big->spans[k].start_handle[i], 8.0 * b->spans[k].start_handle[i], 1e-8) << m << " " << k;
                EXPECT_NEAR(big->spans[k].end_handle[i], 8.0 * b->spans[k].end_handle[i], 1e-8) << m << " " << k;
            }
        }
    }
}

TEST(SplineBezierFromXSpline, CornersFlagsAndFailures)
{
    // All corners with one span each: the spans run between the control points.
    std::vector<Point> points;
    for (int i = 0; i < 6; ++i) points.push_back({100 * std::cos(i * M_PI / 3), 100 * std::sin(i * M_PI / 3), 0.0});
    XSplinePtr corners = make_curve(points);
    BezierPtr polygon(pBezierCurveFromXSpline(corners.get(), 1));
    for (uint32_t k = 0; k < 6; ++k) {
        EXPECT_EQ(xy(polygon->spans[k].start_x, polygon->spans[k].start_y), xy(points[k].x, points[k].y));
        EXPECT_EQ(polygon->spans[k].end_identifier, 100u + (k + 1) % 6);
    }

    // Flags are cleared on spans ending at or beside a point flagged 0.
    XSplinePtr x = make_curve({{0, 0}, {10, 0, 1, 0, 0}, {10, 10}, {0, 10}});
    struct Case {
        int m;
        std::vector<uint32_t> start, end;
    } cases[] = {{2, {1, 0, 0, 0, 1, 1, 1, 1}, {0, 0, 0, 1, 1, 1, 1, 1}}, {1, {1, 0, 1, 1}, {0, 1, 1, 1}}};
    for (const Case &c : cases) {
        BezierPtr b(pBezierCurveFromXSpline(x.get(), c.m));
        for (uint32_t k = 0; k < b->count; ++k) {
            EXPECT_EQ(b->spans[k].start_flag, c.start[k]) << c.m << " " << k;
            EXPECT_EQ(b->spans[k].end_flag, c.end[k]) << c.m << " " << k;
        }
    }
    EXPECT_TRUE(fails_with(pBezierCurveFromXSpline(x.get(), 0), 7));
    x->open = 1;
    EXPECT_TRUE(fails_with(pBezierCurveFromXSpline(x.get(), 2), 7));
    XSplinePtr empty(pXSplineAlloc(0));
    EXPECT_TRUE(fails_with(pBezierCurveFromXSpline(empty.get(), 2), 24));
}

}  // namespace
