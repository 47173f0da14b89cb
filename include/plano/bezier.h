/* BezierCurve: a chain of cubic spans whose inner control points are stored relative to the
 * span ends, edited directly by hosts and used as an exchange form of an XSpline.
 *
 * A span runs from P0 (start) to P3 (end) through the inner control points P0 + h0 and
 * P3 + h1 (h0 the start handle, h1 the end handle). On a closed curve the last span's end
 * joins the first span's start. Curve parameter T in [0, 1] covers span k of n over
 * [k/n, (k+1)/n]; derivatives are with respect to the span's own t.
 *
 * Null curves, spans or required output pointers fail with code 32. */
#ifndef PLANO_BEZIER_H
#define PLANO_BEZIER_H

#include "plano/plano_base.h"
#include "plano/xspline.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct BezierCurveSpan {
    double start_x, start_y; /* P0 */
    double end_x, end_y;     /* P3 */
    double start_handle[2];  /* first inner control point minus P0 */
    double end_handle[2];    /* second inner control point minus P3 */
    uint32_t start_identifier, end_identifier;
    uint32_t start_flag, end_flag; /* 1 after allocation; 0 where the X-spline points were flagged 0 */
} BezierCurveSpan;

typedef struct BezierCurve {
    BezierCurveSpan *spans; /* null when count is 0 */
    uint32_t count;
    uint32_t open; /* 0 closed, nonzero open */
} BezierCurve;

/* A closed curve of n zero-filled spans with both flags 1; null with code 5. */
PLANO_API BezierCurve *pBezierCurveAlloc(uint32_t n);
PLANO_API BezierCurve *pBezierCurveCopy(const BezierCurve *curve);
PLANO_API void vBezierCurveFree(BezierCurve *curve);
/* Fills positions, handles and identifiers; the flags are left alone. */
PLANO_API Plx_Bool bBezierCurveFillSpan(BezierCurveSpan *span, const double start[2], const double end[2],
                                        const double start_handle[2], const double end_handle[2],
                                        uint32_t start_identifier, uint32_t end_identifier);

/* The cubic at t in [0, 1] and (when asked) its derivative in t; nothing for a null span. */
PLANO_API void vBezierSpanComputeVertex(const BezierCurveSpan *span, double t, double point[2],
                                        double derivative[2]);
/* The curve at T: span trunc(T n) at the remainder, T = 1 the last span's end. T outside
 * [0, 1] fails with code 7; a curve without spans with code 24. */
PLANO_API Plx_Bool bBezierCurveComputeVertex(const BezierCurve *curve, double T, double point[2],
                                             double derivative[2]);
PLANO_API Plx_Bool bBezierCurveSpanMidpoint(const BezierCurveSpan *span, double point[2]);
/* 1 when the span's x coordinate turns back strictly inside the span, else 0. */
PLANO_API Plx_Bool bBezierCurveSpanComputeBackwards(const BezierCurveSpan *span);
/* A = (start x, largest y) and B = (end x, smallest y) over the ends and handle tips. */
PLANO_API void vBezierCurveSpanBoundingBoxLimitedTangents(const BezierCurveSpan *span, double A[2], double B[2]);
/* Box of the span ends, with the handle tips when include_handles is nonzero. An empty curve
 * gives zeros and returns 0 without an error record. */
PLANO_API Plx_Bool bBezierCurveBoundingBox(const BezierCurve *curve, double min[2], double max[2],
                                           uint32_t include_handles);
/* Centre of the box of the span ends; an empty curve as for the box. */
PLANO_API Plx_Bool bBezierCurveCentre(const BezierCurve *curve, double centre[2]);

/* Unit normal at the start of span index (index n is the end of an open curve): the sum of
 * the outgoing and incoming unit directions (handles, or chords where a handle is shorter
 * than a tenth of its chord) turned a quarter turn as (d.y, -d.x); a random unit direction
 * where they cancel. An index out of range fails with code 32. */
PLANO_API Plx_Bool bBezierComputeNormal(const BezierCurve *curve, uint32_t index, double normal[2]);
/* Corner widening factor at the start of span index between the previous span's start and
 * this span's end, in single precision; 1 at index 0 of an open curve. An index past the end
 * registers code 7 and returns FLT_MAX. */
PLANO_API double dBezierEdgeScale(const BezierCurve *curve, uint32_t index);

/* A closed X-spline of n points as n m cubic spans: span ends on the curve with handles
 * along its tangents, their lengths chosen so the cubic passes through the curve's point
 * halfway along the span where that is possible. Corner points (shape 0) become span ends
 * exactly. An open curve or m <= 0 fails with code 7; a curve without points with code 24. */
PLANO_API BezierCurve *pBezierCurveFromXSpline(const XSpline *curve, int32_t m);

#ifdef __cplusplus
}
#endif

#endif
