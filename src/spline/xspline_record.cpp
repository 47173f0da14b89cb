// XSpline records: allocation, copies, filling and looking up control points, the box of the
// control points and the display form of T.
#include <cmath>

#include "common/internal.hpp"
#include "spline/spline_internal.hpp"

using plano::spline::check_not_null;

namespace {

// Fills every field; the shape is checked first so that a refused point stays as it was.
bool fill_point(XSplineControlPoint *point, const double position[2], double shape, uint32_t identifier,
                double edge_width, double second_value, const double direction[2], uint32_t flag,
                const char *function)
{
    if (!check_not_null({point, position}, function)) return false;
    if (!(shape >= 0.0 && shape <= 1.0)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "shape outside [0, 1]", 0);
        return false;
    }
    point->x = position[0];
    point->y = position[1];
    point->shape = shape;
    point->identifier = identifier;
    point->edge_width = edge_width;
    point->second_value = second_value;
    point->direction[0] = direction != nullptr ? direction[0] : 1.0;
    point->direction[1] = direction != nullptr ? direction[1] : 0.0;
    point->normal[0] = 0.0;
    point->normal[1] = 0.0;
    point->flag = flag;
    return true;
}

}  // namespace

extern "C" {

PLANO_API XSpline *pXSplineAlloc(uint32_t count)
{
    return plano::spline::alloc_record(count, &XSpline::control_points);
}

PLANO_API XSpline *pXSplineCopy(const XSpline *curve)
{
    return plano::spline::copy_record(curve, &XSpline::control_points);
}

PLANO_API void vXSplineFree(XSpline *curve)
{
    plano::spline::free_record(curve, &XSpline::control_points);
}

PLANO_API Plx_Bool bXSplineFillControlPoint(XSplineControlPoint *point, const double position[2], double shape,
                                            uint32_t identifier, double edge_width, double second_value,
                                            const double direction[2])
{
    return fill_point(point, position, shape, identifier, edge_width, second_value, direction, 1u, __func__);
}

PLANO_API Plx_Bool bXSplineFillControlPointEx(XSplineControlPoint *point, const double position[2], double shape,
                                              uint32_t identifier, double edge_width, double second_value,
                                              const double direction[2], uint32_t flag)
{
    return fill_point(point, position, shape, identifier, edge_width, second_value, direction, flag, __func__);
}

PLANO_API XSplineControlPoint *pXSplineGetControlPoint(const XSpline *curve, uint32_t identifier)
{
    if (curve == nullptr || curve->control_points == nullptr) return nullptr;
    for (uint32_t i = 0; i < curve->count; ++i)
        if (curve->control_points[i].identifier == identifier) return &curve->control_points[i];
    return nullptr;
}

PLANO_API Plx_Bool bXSplineBoundingBox(const XSpline *curve, double min[2], double max[2])
{
    if (!check_not_null({min, max}) || !plano::spline::check_record(curve, &XSpline::control_points)) return 0;
    min[0] = min[1] = max[0] = max[1] = 0.0;
    if (curve->count == 0) return 0;
    const XSplineControlPoint *points = curve->control_points;
    min[0] = max[0] = points[0].x;
    min[1] = max[1] = points[0].y;
    for (uint32_t i = 1; i < curve->count; ++i) {
        min[0] = std::fmin(min[0], points[i].x);
        min[1] = std::fmin(min[1], points[i].y);
        max[0] = std::fmax(max[0], points[i].x);
        max[1] = std::fmax(max[1], points[i].y);
    }
    return 1;
}

PLANO_API float fXSplineShowTValues(float flag, float T)
{
    if (!(flag > 0.5f)) return 0.0f;
    // 0 in a T image means "no curve here", so the ends of the range are kept off it.
    if (T >= 1.0f) return 0.99999f;
    if (T <= 0.0f) return 1e-05f;
    return T;
}

}  // extern "C"
