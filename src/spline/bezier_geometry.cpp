// Geometry at Bezier span ends: the unit normal and the corner widening factor.
#include <cfloat>
#include <cmath>

#include "common/internal.hpp"
#include "plano/bezier.h"
#include "spline/spline_internal.hpp"

namespace {

// The handle as a unit direction, or the chord where the handle is too short to say where
// the curve goes (under a tenth of the chord); (0, 0) when both vanish.
void direction_of(const double handle[2], double chord_x, double chord_y, double direction[2])
{
    const double h2 = handle[0] * handle[0] + handle[1] * handle[1];
    const double c2 = chord_x * chord_x + chord_y * chord_y;
    double d[2] = {handle[0], handle[1]};
    if (h2 < 0.01 * c2) {
        d[0] = chord_x;
        d[1] = chord_y;
    }
    const double length = std::hypot(d[0], d[1]);
    direction[0] = length > 0.0 ? d[0] / length : 0.0;
    direction[1] = length > 0.0 ? d[1] / length : 0.0;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bBezierComputeNormal(const BezierCurve *curve, uint32_t index, double normal[2])
{
    if (!plano::spline::check_not_null({normal}) || !plano::spline::check_nonempty(curve, &BezierCurve::spans))
        return 0;
    const uint32_t n = curve->count;
    if (!(index < n || (curve->open && index == n))) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "index out of range", index);
        return 0;
    }
    double out[2] = {0.0, 0.0}, in[2] = {0.0, 0.0};
    if (index < n) {
        const BezierCurveSpan &s = curve->spans[index];
        direction_of(s.start_handle, s.end_x - s.start_x, s.end_y - s.start_y, out);
    }
    // Every point but the start of an open curve has a span coming in.
    if (index > 0 || !curve->open) {
        const BezierCurveSpan &s = curve->spans[index > 0 ? index - 1 : n - 1];
        direction_of(s.end_handle, s.start_x - s.end_x, s.start_y - s.end_y, in);
    }
    // The incoming handle points back along the curve, so the difference is the sum of the
    // two directions of travel.
    double d[2] = {out[0] - in[0], out[1] - in[1]};
    const double length = std::hypot(d[0], d[1]);
    if (length == 0.0) {
        plano::spline::random_unit_direction(normal);
        return 1;
    }
    normal[0] = d[1] / length;
    normal[1] = -d[0] / length;
    return 1;
}

PLANO_API double dBezierEdgeScale(const BezierCurve *curve, uint32_t index)
{
    if (!plano::spline::check_edge_scale_index(curve, &BezierCurve::spans, index)) return double(FLT_MAX);
    if (curve->open && index == 0) return 1.0;
    const BezierCurveSpan &s = curve->spans[index];
    const BezierCurveSpan &previous = curve->spans[index > 0 ? index - 1 : curve->count - 1];
    return plano::spline::edge_scale_single(s.start_x, s.start_y, previous.start_x, previous.start_y, s.end_x,
                                            s.end_y);
}

}  // extern "C"
