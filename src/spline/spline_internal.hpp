// Helpers shared by the curve sources: argument checks, the span of four control points,
// the blending weights, and the rational quintic pieces the evaluator and the renderers use.
#ifndef PLANO_SRC_SPLINE_SPLINE_INTERNAL_HPP
#define PLANO_SRC_SPLINE_SPLINE_INTERNAL_HPP

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <initializer_list>

#include "pellux/detail/util.hpp"
#include "pellux/error.h"
#include "plano/xspline.h"

namespace plano::spline {

// Registers code 32 under function when any pointer is null.
bool check_not_null(std::initializer_list<const void *> pointers, const char *function = __builtin_FUNCTION());
// Both curve records are (elements, count, open). A record passes when it is given and
// holds its elements; otherwise code 32 is registered under function.
template <class Curve, class Element>
bool check_record(const Curve *curve, Element *Curve::*elements, const char *function = __builtin_FUNCTION())
{
    if (curve != nullptr && (curve->count == 0 || curve->*elements != nullptr)) return true;
    PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null curve", 0);
    return false;
}
// A record with at least one element; code 32 (null curve) or code 24 (none) otherwise.
template <class Curve, class Element>
bool check_nonempty(const Curve *curve, Element *Curve::*elements, const char *function = __builtin_FUNCTION())
{
    if (!check_record(curve, elements, function)) return false;
    if (curve->count > 0) return true;
    PLX_ERR_START_AS(function, PLX_ERROR_NOT_ENOUGH_DATA, "empty curve", 0);
    return false;
}
inline bool check_curve(const XSpline *curve, const char *function = __builtin_FUNCTION())
{
    return check_nonempty(curve, &XSpline::control_points, function);
}
// The index of an edge-scale query; code 32 (null curve) or code 7 (past the end) otherwise.
template <class Curve, class Element>
bool check_edge_scale_index(const Curve *curve, Element *Curve::*elements, uint32_t index,
                            const char *function = __builtin_FUNCTION())
{
    if (!check_record(curve, elements, function)) return false;
    if (index < curve->count) return true;
    PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "index past the end", index);
    return false;
}

// A closed record of count zero-filled elements (none when count is 0); code 5 under
// function when out of memory.
template <class Curve, class Element>
Curve *alloc_record(uint32_t count, Element *Curve::*elements, const char *function = __builtin_FUNCTION())
{
    plx::HeapPtr<Curve> curve(plx::heap_alloc<Curve>(1, function, __FILE__, __LINE__));
    if (curve == nullptr) return nullptr;
    *curve = Curve{nullptr, count, 0u};
    if (count > 0) {
        Element *e = plx::heap_alloc<Element>(count, function, __FILE__, __LINE__);
        if (e == nullptr) return nullptr;
        std::memset(e, 0, sizeof(Element) * count);
        (*curve).*elements = e;
    }
    return curve.release();
}
// A copy with the same count, open flag and elements.
template <class Curve, class Element>
Curve *copy_record(const Curve *curve, Element *Curve::*elements, const char *function = __builtin_FUNCTION())
{
    if (!check_record(curve, elements, function)) return nullptr;
    Curve *copy = alloc_record(curve->count, elements, function);
    if (copy == nullptr) return nullptr;
    copy->open = curve->open;
    if (curve->count > 0) std::memcpy(copy->*elements, curve->*elements, sizeof(Element) * curve->count);
    return copy;
}

// Frees the elements and the record.
template <class Curve, class Element>
void free_record(Curve *curve, Element *Curve::*elements)
{
    if (curve == nullptr) return;
    std::free(curve->*elements);
    std::free(curve);
}

// dSplineEdgeScaleFromPoints on coordinates first rounded to single precision, as the
// rendered polygons hold them.
double edge_scale_single(double x0, double y0, double x1, double y1, double x2, double y2);

// Shapes are read inside [0, 1] so that 1 + s never vanishes; NaN reads as 0.
inline double shape_of(const XSplineControlPoint &point)
{
    const double s = point.shape;
    return s > 0.0 ? (s < 1.0 ? s : 1.0) : 0.0;
}

// The blending function's p for a point of shape s: 2 (1 + s)^2.
inline double blend_p(double s) { return 2.0 * (1.0 + s) * (1.0 + s); }

// The four points that shape span k: the point before, the span's two ends and the point
// after, wrapped on a closed curve and clamped on an open one. Needs count > 0.
struct Span {
    const XSplineControlPoint *p[4];
};
Span span_of(const XSpline &curve, uint32_t k);

// The weighted mean of the span's four points at local t in [0, 1] (0 at p[1], 1 at p[2]);
// the weight sum is positive for shapes in [0, 1].
void span_point(const Span &span, double t, double vertex[2]);

// Bernstein coefficients over [0, 1] of tau -> F(intercept + slope * tau, p).
void blend_term_coefficients(double intercept, double slope, double p, double coefficients[6]);

// Fills every field of cache but span_start with the pieces of span (local parameter tau,
// p[0] at 0, p[1] at L, p[2] at 2L).
void build_span_pieces(const Span &span, double L, XSplineControlStruct *cache);
// The non-empty piece that holds tau (pieces tile [L, 2L]; a tau at or past the last end
// goes to the last piece); -1 when every piece is empty.
int piece_holding(const XSplineControlStruct &cache, double tau);

// A random direction from the runtime's rand(), each component in [-1, 1), drawn again
// while both are 0, then normalised.
void random_unit_direction(double direction[2]);

}  // namespace plano::spline

#endif
