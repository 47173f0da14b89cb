// Geometry at X-spline control points: the unit normal and the corner widening factor that
// keeps a feather its width around a sharp corner.
#include <cfloat>
#include <cmath>

#include "common/internal.hpp"
#include "spline/spline_internal.hpp"

extern "C" {

PLANO_API Plx_Bool bXSplineComputeNormal(XSpline *curve, uint32_t index)
{
    if (!plano::spline::check_curve(curve)) return 0;
    if (curve->open) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "open curve", 0);
        return 0;
    }
    if (index >= curve->count) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "index past the last control point", index);
        return 0;
    }
    const plano::spline::Span span = plano::spline::span_of(*curve, index);
    const XSplineControlPoint &previous = *span.p[0], &next = *span.p[2];
    XSplineControlPoint &point = curve->control_points[index];
    // The edges to both neighbours turned a quarter turn.
    const double d1[2] = {previous.y - point.y, point.x - previous.x};
    const double d2[2] = {next.y - point.y, point.x - next.x};
    const double l1 = std::hypot(d1[0], d1[1]), l2 = std::hypot(d2[0], d2[1]);
    double n[2];
    if (l1 == 0.0 && l2 == 0.0) {
        plano::spline::random_unit_direction(point.normal);
        return 1;
    }
    if (l1 == 0.0 || l2 == 0.0) {
        const double *d = l1 == 0.0 ? d2 : d1;
        const double l = l1 == 0.0 ? l2 : l1;
        n[0] = d[0] / l;
        n[1] = d[1] / l;
    } else {
        n[0] = d2[0] / l2 - d1[0] / l1;
        n[1] = d2[1] / l2 - d1[1] / l1;
        const double l = std::hypot(n[0], n[1]);
        if (l == 0.0) {
            PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "both neighbours in the same direction", index);
            return 0;
        }
        n[0] /= l;
        n[1] /= l;
    }
    point.normal[0] = n[0];
    point.normal[1] = n[1];
    return 1;
}

PLANO_API double dSplineEdgeScaleFromPoints(double x0, double y0, double x1, double y1, double x2, double y2)
{
    const double d01 = (x1 - x0) * (x1 - x0) + (y1 - y0) * (y1 - y0);
    const double d02 = (x2 - x0) * (x2 - x0) + (y2 - y0) * (y2 - y0);
    const double d12 = (x2 - x1) * (x2 - x1) + (y2 - y1) * (y2 - y1);
    if (d01 == 0.0 || d02 == 0.0) return 1.0;
    // Rounding can carry the cosine of a straight or folded corner just outside [-1, 1].
    const double cosine = std::fmax(-1.0, std::fmin(1.0, (d02 + d01 - d12) * 0.5 / std::sqrt(d02 * d01)));
    const double sine = std::fabs(std::sin(0.5 * std::acos(cosine)));
    if (sine == 0.0) return 1.0;
    return std::fmin(1.0 / sine, 3.0);
}

PLANO_API double dXSplineEdgeScale(const XSpline *curve, uint32_t index)
{
    if (!plano::spline::check_edge_scale_index(curve, &XSpline::control_points, index)) return double(FLT_MAX);
    if (curve->open && (index == 0 || index + 1 == curve->count)) return 1.0;
    const plano::spline::Span span = plano::spline::span_of(*curve, index);
    const XSplineControlPoint &at = *span.p[1], &previous = *span.p[0], &next = *span.p[2];
    return plano::spline::edge_scale_single(at.x, at.y, previous.x, previous.y, next.x, next.y);
}

}  // extern "C"
