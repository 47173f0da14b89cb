// Conversion of a closed X-spline into a Bezier curve: m cubic spans per X-spline span, each
// meeting the X-spline at its ends with the same tangent directions.
#include <cmath>
#include <cstdint>

#include "common/internal.hpp"
#include "plano/bezier.h"
#include "spline/spline_internal.hpp"

namespace {

struct Sample {
    double point[2], tangent[2];
};

void make_unit(double v[2])
{
    const double length = std::hypot(v[0], v[1]);
    if (length > 0.0) {
        v[0] /= length;
        v[1] /= length;
    }
}

// Chooses the handle lengths along the unit directions h0 and h1: where it can, the cubic
// passes through the X-spline's point halfway along the span (its value at t = 0.5 is
// (P0 + P3)/2 + 0.375 (h0 + h1)); otherwise both handles are a quarter of the chord.
void fit_handle_lengths(const double P0[2], const double P3[2], const double middle[2], double h0[2], double h1[2])
{
    const double g0[2] = {0.375 * h0[0], 0.375 * h0[1]}, g1[2] = {0.375 * h1[0], 0.375 * h1[1]};
    const double D = g1[1] * g0[0] - g0[1] * g1[0];
    const double chord = std::hypot(P3[0] - P0[0], P3[1] - P0[1]);
    double a = chord / 4.0, b = chord / 4.0;
    if (D != 0.0) {
        const double e[2] = {middle[0] - 0.5 * (P0[0] + P3[0]), middle[1] - 0.5 * (P0[1] + P3[1])};
        const double alpha = (e[0] * g1[1] - e[1] * g1[0]) / D, beta = (g0[0] * e[1] - g0[1] * e[0]) / D;
        const double reach = std::hypot(alpha * h0[0], alpha * h0[1]) + std::hypot(beta * h1[0], beta * h1[1]);
        if (alpha > 0.0 && beta > 0.0 && reach <= chord) {
            a = alpha;
            b = beta;
        } else if (!(chord > 0.0)) {
            return;
        }
    }
    h0[0] *= a;
    h0[1] *= a;
    h1[0] *= b;
    h1[1] *= b;
}

}  // namespace

extern "C" {

PLANO_API BezierCurve *pBezierCurveFromXSpline(const XSpline *curve, int32_t m)
{
    if (!plano::spline::check_curve(curve)) return nullptr;
    if (curve->open || m <= 0) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, curve->open ? "open curve" : "spans per span not positive", m);
        return nullptr;
    }
    const uint32_t n = curve->count;
    const uint64_t total = uint64_t(n) * uint64_t(m);
    if (total > UINT32_MAX) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "too many spans", int64_t(total));
        return nullptr;
    }
    BezierCurve *bezier = pBezierCurveAlloc(uint32_t(total));
    if (bezier == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    const XSplineControlPoint *points = curve->control_points;
    XSplineControlStruct cache;
    vXSplineInitControlStruct(&cache);
    bool failed = false;
    auto sample = [&](double T) {
        Sample s{};
        if (!failed && !bXSplineComputeVertexSimple(curve, T, s.point, s.tangent, nullptr, nullptr, &cache))
            failed = true;
        return s;
    };
    // A span end at a corner has no tangent: its handle aims at the curve a hundredth of a
    // span along.
    auto corner_handle = [&](const XSplineControlPoint &corner, double T, double handle[2]) {
        const Sample s = sample(T);
        handle[0] = s.point[0] - corner.x;
        handle[1] = s.point[1] - corner.y;
        make_unit(handle);
    };
    // Whether a control point next to position numerator / m along the curve (in control-point
    // units: the point there, or the two it lies between) is flagged 0.
    auto flagged_off = [&](uint64_t numerator) {
        const uint64_t below = numerator / uint64_t(m), above = (numerator + uint64_t(m) - 1) / uint64_t(m);
        return points[below % n].flag == 0 || points[above % n].flag == 0;
    };

    for (uint64_t k = total; k-- > 0 && !failed;) {
        const uint32_t j = uint32_t(k / uint64_t(m)), r = uint32_t(k % uint64_t(m)), next = (j + 1) % n;
        const double T0 = double(k) / double(total), T1 = double(k + 1) / double(total);
        BezierCurveSpan &span = bezier->spans[k];
        span.start_identifier = points[j].identifier;
        if (flagged_off(k)) span.start_flag = 0;
        if (flagged_off(k + 1)) span.end_flag = 0;

        double P0[2], P3[2], h0[2], h1[2];
        if (r == 0 && plano::spline::shape_of(points[j]) == 0.0) {
            P0[0] = points[j].x;
            P0[1] = points[j].y;
            corner_handle(points[j], (j + 0.01) / n, h0);
        } else {
            const Sample s = sample(T0);
            P0[0] = s.point[0];
            P0[1] = s.point[1];
            h0[0] = s.tangent[0];
            h0[1] = s.tangent[1];
        }
        if (r == uint32_t(m) - 1 && plano::spline::shape_of(points[next]) == 0.0) {
            P3[0] = points[next].x;
            P3[1] = points[next].y;
            corner_handle(points[next], (j + 0.99) / n, h1);
            span.end_identifier = points[next].identifier;
        } else {
            const Sample s = sample(T1);
            P3[0] = s.point[0];
            P3[1] = s.point[1];
            h1[0] = -s.tangent[0];
            h1[1] = -s.tangent[1];
        }
        const Sample middle = sample(0.5 * (T0 + T1));
        if (failed) break;
        fit_handle_lengths(P0, P3, middle.point, h0, h1);
        bBezierCurveFillSpan(&span, P0, P3, h0, h1, span.start_identifier, span.end_identifier);
    }
    if (failed) {
        PLX_ERR_PASS();
        vBezierCurveFree(bezier);
        return nullptr;
    }
    return bezier;
}

}  // extern "C"
