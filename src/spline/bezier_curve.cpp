// Bezier curves: records, evaluation of spans and curves, the turning-back test, boxes and
// the centre.
#include <algorithm>
#include <cmath>

#include "common/internal.hpp"
#include "plano/bezier.h"
#include "spline/spline_internal.hpp"

using plano::spline::check_not_null;

namespace {

// Power-form coefficients of one coordinate of the cubic: P0 + a t + b t^2 + c t^3.
struct Cubic {
    double a, b, c;
};
Cubic cubic_of(double p0, double p3, double h0, double h1)
{
    const double a = 3.0 * h0;
    const double b = 3.0 * ((p3 + h1) - (p0 + h0)) - a;
    return Cubic{a, b, p3 - p0 - a - b};
}

bool check_bezier(const BezierCurve *curve, const char *function = __builtin_FUNCTION())
{
    return plano::spline::check_record(curve, &BezierCurve::spans, function);
}

}  // namespace

extern "C" {

PLANO_API BezierCurve *pBezierCurveAlloc(uint32_t n)
{
    BezierCurve *curve = plano::spline::alloc_record(n, &BezierCurve::spans);
    if (curve == nullptr) return nullptr;
    for (uint32_t i = 0; i < n; ++i) curve->spans[i].start_flag = curve->spans[i].end_flag = 1u;
    return curve;
}

PLANO_API BezierCurve *pBezierCurveCopy(const BezierCurve *curve)
{
    return plano::spline::copy_record(curve, &BezierCurve::spans);
}

PLANO_API void vBezierCurveFree(BezierCurve *curve)
{
    plano::spline::free_record(curve, &BezierCurve::spans);
}

PLANO_API Plx_Bool bBezierCurveFillSpan(BezierCurveSpan *span, const double start[2], const double end[2],
                                        const double start_handle[2], const double end_handle[2],
                                        uint32_t start_identifier, uint32_t end_identifier)
{
    if (!check_not_null({span, start, end, start_handle, end_handle})) return 0;
    span->start_x = start[0];
    span->start_y = start[1];
    span->end_x = end[0];
    span->end_y = end[1];
    span->start_handle[0] = start_handle[0];
    span->start_handle[1] = start_handle[1];
    span->end_handle[0] = end_handle[0];
    span->end_handle[1] = end_handle[1];
    span->start_identifier = start_identifier;
    span->end_identifier = end_identifier;
    return 1;
}

PLANO_API void vBezierSpanComputeVertex(const BezierCurveSpan *span, double t, double point[2], double derivative[2])
{
    if (span == nullptr || point == nullptr) return;
    const double p0[2] = {span->start_x, span->start_y}, p3[2] = {span->end_x, span->end_y};
    for (int i = 0; i < 2; ++i) {
        const Cubic q = cubic_of(p0[i], p3[i], span->start_handle[i], span->end_handle[i]);
        point[i] = ((q.c * t + q.b) * t + q.a) * t + p0[i];
        if (derivative != nullptr) derivative[i] = (3.0 * q.c * t + 2.0 * q.b) * t + q.a;
    }
}

PLANO_API Plx_Bool bBezierCurveComputeVertex(const BezierCurve *curve, double T, double point[2],
                                             double derivative[2])
{
    if (!plano::spline::check_nonempty(curve, &BezierCurve::spans) || !check_not_null({point})) return 0;
    if (!(T >= 0.0 && T <= 1.0)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "T outside [0, 1]", 0);
        return 0;
    }
    const uint32_t n = curve->count;
    // T just below 1 may round up to n spans: it belongs to the last span's end.
    const uint32_t k = T == 1.0 ? n - 1 : std::min(uint32_t(T * n), n - 1);
    const double t = T == 1.0 ? 1.0 : T * n - k;
    vBezierSpanComputeVertex(&curve->spans[k], t, point, derivative);
    return 1;
}

PLANO_API Plx_Bool bBezierCurveSpanMidpoint(const BezierCurveSpan *span, double point[2])
{
    if (!check_not_null({span, point})) return 0;
    vBezierSpanComputeVertex(span, 0.5, point, nullptr);
    return 1;
}

PLANO_API Plx_Bool bBezierCurveSpanComputeBackwards(const BezierCurveSpan *span)
{
    if (!check_not_null({span})) return 0;
    // Roots of the x derivative a + 2b t + 3c t^2 strictly inside the span.
    const Cubic q = cubic_of(span->start_x, span->end_x, span->start_handle[0], span->end_handle[0]);
    auto inside = [](double t) { return t > 0.0 && t < 1.0; };
    if (q.c == 0.0) {
        // A quadratic in x turns back only at the one root of its linear derivative.
        return q.b != 0.0 && inside(-q.a / (2.0 * q.b)) ? 1 : 0;
    }
    const double discriminant = q.b * q.b - 3.0 * q.c * q.a;
    if (discriminant < 0.0) return 0;
    const double root = std::sqrt(discriminant);
    return inside((-q.b + root) / (3.0 * q.c)) || inside((-q.b - root) / (3.0 * q.c)) ? 1 : 0;
}

PLANO_API void vBezierCurveSpanBoundingBoxLimitedTangents(const BezierCurveSpan *span, double A[2], double B[2])
{
    if (span == nullptr || A == nullptr || B == nullptr) return;
    const double ys[4] = {span->start_y, span->end_y, span->start_y + span->start_handle[1],
                          span->end_y + span->end_handle[1]};
    A[0] = span->start_x;
    B[0] = span->end_x;
    A[1] = B[1] = ys[0];
    for (double y : ys) {
        A[1] = std::fmax(A[1], y);
        B[1] = std::fmin(B[1], y);
    }
}

PLANO_API Plx_Bool bBezierCurveBoundingBox(const BezierCurve *curve, double min[2], double max[2],
                                           uint32_t include_handles)
{
    if (!check_bezier(curve) || !check_not_null({min, max})) return 0;
    min[0] = min[1] = max[0] = max[1] = 0.0;
    if (curve->count == 0) return 0;
    min[0] = max[0] = curve->spans[0].start_x;
    min[1] = max[1] = curve->spans[0].start_y;
    auto take = [min, max](double x, double y) {
        min[0] = std::fmin(min[0], x);
        min[1] = std::fmin(min[1], y);
        max[0] = std::fmax(max[0], x);
        max[1] = std::fmax(max[1], y);
    };
    for (uint32_t i = 0; i < curve->count; ++i) {
        const BezierCurveSpan &s = curve->spans[i];
        take(s.end_x, s.end_y);
        if (include_handles) {
            take(s.start_x + s.start_handle[0], s.start_y + s.start_handle[1]);
            take(s.end_x + s.end_handle[0], s.end_y + s.end_handle[1]);
        }
    }
    return 1;
}

PLANO_API Plx_Bool bBezierCurveCentre(const BezierCurve *curve, double centre[2])
{
    if (!check_not_null({centre})) return 0;
    double min[2], max[2];
    const Plx_Bool ok = bBezierCurveBoundingBox(curve, min, max, 0);
    centre[0] = 0.5 * (min[0] + max[0]);
    centre[1] = 0.5 * (min[1] + max[1]);
    return ok;
}

}  // extern "C"
