// Helpers of the curve tests: owning pointers, curves from tables, random curves, and the
// blending of a span written out plainly as an independent reference.
#ifndef PLANO_TESTS_SPLINE_TEST_UTIL_HPP
#define PLANO_TESTS_SPLINE_TEST_UTIL_HPP

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <memory>
#include <random>
#include <vector>

#include "plano/plano.h"

namespace spline_test {

template <auto Free>
struct FreeWith {
    template <class T>
    void operator()(T *p) const { Free(p); }
};
using XSplinePtr = std::unique_ptr<XSpline, FreeWith<vXSplineFree>>;
using BezierPtr = std::unique_ptr<BezierCurve, FreeWith<vBezierCurveFree>>;

struct Point {
    double x, y, shape = 1.0, width = 0.0;
    uint32_t flag = 1;
};

inline XSplinePtr make_curve(const std::vector<Point> &points, bool open = false)
{
    XSplinePtr c(pXSplineAlloc(uint32_t(points.size())));
    c->open = open ? 1u : 0u;
    for (uint32_t i = 0; i < c->count; ++i) {
        const double position[2] = {points[i].x, points[i].y};
        EXPECT_TRUE(bXSplineFillControlPointEx(&c->control_points[i], position, points[i].shape, 100 + i,
                                               points[i].width, 1.0, nullptr, points[i].flag));
    }
    return c;
}

// Points round a wobbly circle with random shapes and widths.
inline std::vector<Point> random_points(std::mt19937 &rng, int n, double radius = 100.0)
{
    std::uniform_real_distribution<double> unit(0.0, 1.0);
    std::vector<Point> points;
    for (int i = 0; i < n; ++i) {
        const double a = 2.0 * M_PI * (i + 0.6 * unit(rng)) / n, r = radius * (0.6 + 0.8 * unit(rng));
        points.push_back({200.0 + r * std::cos(a), 150.0 + r * std::sin(a), unit(rng), 10.0 * unit(rng)});
    }
    return points;
}

inline double F(double u, double p) { return u * u * u * ((6 - p) * u * u + (2 * p - 15) * u + (10 - p)); }

// The curve point at T by blending the four points of its span, with the span's weights as
// written in the definition of the curve.
inline std::vector<double> reference_point(const XSpline &c, double T)
{
    const int n = int(c.count);
    if (T >= 1.0) T = c.open ? 0.99999999 : 0.0;
    const int k = std::min(int(T * n), n - 1);
    const double t = T * n - k;
    auto at = [&](int i) -> const XSplineControlPoint & {
        i = c.open ? std::clamp(i, 0, n - 1) : ((i % n) + n) % n;
        return c.control_points[i];
    };
    const XSplineControlPoint *P[4] = {&at(k - 1), &at(k), &at(k + 1), &at(k + 2)};
    const double s1 = P[1]->shape, s2 = P[2]->shape;
    const double w[4] = {t < s1 ? F((s1 - t) / (1 + s1), 2 * (1 + s1) * (1 + s1)) : 0.0,
                         F((1 + s2 - t) / (1 + s2), 2 * (1 + s2) * (1 + s2)),
                         F((t + s1) / (1 + s1), 2 * (1 + s1) * (1 + s1)),
                         t > 1 - s2 ? F((t - 1 + s2) / (1 + s2), 2 * (1 + s2) * (1 + s2)) : 0.0};
    double x = 0, y = 0, sum = 0;
    for (int i = 0; i < 4; ++i) {
        x += w[i] * P[i]->x;
        y += w[i] * P[i]->y;
        sum += w[i];
    }
    return {x / sum, y / sum};
}

// Position, tangent, curvature vector and width at T through a fresh cache.
struct Eval {
    double v[2], tangent[2], second[2], width;
};
inline Eval evaluate(const XSpline *c, double T)
{
    XSplineControlStruct cache;
    vXSplineInitControlStruct(&cache);
    Eval e{};
    EXPECT_TRUE(bXSplineComputeVertexSimple(c, T, e.v, e.tangent, e.second, &e.width, &cache)) << "T = " << T;
    return e;
}

}  // namespace spline_test

#endif
