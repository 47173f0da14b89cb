/* XSpline: the rotoscoping curve, an open or closed chain of control points each with its
 * own shape value and edge (feather) width.
 *
 * Curve parameter T runs over [0, 1]. With n control points and L = 1/n, span k covers
 * [kL, (k+1)L] and runs from point k to point k+1. A closed curve wraps its indices; an open
 * one clamps them (the point before point 0 is point 0, the point after n-1 is n-1), so its
 * last span is a short tail that settles onto the last control point. T = 1 is read as 0 on
 * a closed curve and as 0.99999999 on an open one.
 *
 * Blending: on the span from P1 to P2 with neighbours P0 and P3, local t in [0, 1] and
 * shapes s1 (of P1) and s2 (of P2), the weights are F(u, p) of the blending function
 *     F(u, p) = u^3 ((6 - p) u^2 + (2p - 15) u + (10 - p))
 * at u = (s1 - t)/(1 + s1) for P0 (only while t < s1), (1 + s2 - t)/(1 + s2) for P1,
 * (t + s1)/(1 + s1) for P2 and (t - 1 + s2)/(1 + s2) for P3 (only while t > 1 - s2), with
 * p = 2(1 + s)^2 of the shape that sets u. The curve point is the weighted mean. Shape 0
 * makes the curve pass through the point with a corner; shape 1 is the smoothest.
 *
 * Over any stretch of a span where the set of non-zero weights is fixed, the curve is a
 * rational quintic; the evaluation cache keeps a span as up to three such pieces in
 * Bernstein form over the local parameter tau (P0 at 0, P1 at L, P2 at 2L, P3 at 3L) and
 * evaluates them directly at tau.
 *
 * Shapes are read clamped into [0, 1] (a NaN shape as 0). Null curves, points or output
 * pointers that are required fail with code 32; a curve without control points fails with
 * code 24 wherever a point is needed. */
#ifndef PLANO_XSPLINE_H
#define PLANO_XSPLINE_H

#include "plano/plano_base.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct XSplineControlPoint {
    double x, y;         /* position in image coordinates */
    double shape;        /* in [0, 1]: 0 interpolates with a corner, 1 is smoothest */
    uint32_t identifier; /* caller's label */
    double edge_width;   /* feather width in pixels */
    double second_value; /* a further per-point scalar, carried and copied */
    double direction[2]; /* given to the fill functions; (1, 0) when none is given */
    double normal[2];    /* unit normal, written by bXSplineComputeNormal; (0, 0) after a fill */
    uint32_t flag;       /* 1 after bXSplineFillControlPoint */
} XSplineControlPoint;

typedef struct XSpline {
    XSplineControlPoint *control_points; /* null when count is 0 */
    uint32_t count;
    uint32_t open; /* 0 closed (the last point joins the first), nonzero open */
} XSpline;

/* The cached evaluation state of one span (see bXSplineComputeVertexSimple). Coefficients
 * are 6 Bernstein rows of (X, Y, Z, W) per piece: X and Y are the weighted positions, W the
 * weight sum and Z is kept at 0. An empty piece has its start equal to its end. */
typedef struct XSplineControlStruct {
    const XSplineControlPoint *span_start; /* null: rebuild on the next evaluation */
    double length, length_squared;         /* L = 1/n and L^2 */
    double coefficients[3][6][4];
    double widths[3][3]; /* per piece: edge widths of the span's two points, and L */
    double piece_start[3]; /* in tau */
    double piece_end[3];
} XSplineControlStruct;

/* A curve of count zero-filled points (none when count is 0), closed; null with code 5. */
PLANO_API XSpline *pXSplineAlloc(uint32_t count);
PLANO_API XSpline *pXSplineCopy(const XSpline *curve);
PLANO_API void vXSplineFree(XSpline *curve);

/* Fills every field of a point: flag 1, normal (0, 0), direction as given or (1, 0) when
 * null. A shape outside [0, 1] (or NaN) fails with code 32 and leaves the point as it was. */
PLANO_API Plx_Bool bXSplineFillControlPoint(XSplineControlPoint *point, const double position[2], double shape,
                                            uint32_t identifier, double edge_width, double second_value,
                                            const double direction[2]);
/* The same with the flag given. */
PLANO_API Plx_Bool bXSplineFillControlPointEx(XSplineControlPoint *point, const double position[2], double shape,
                                              uint32_t identifier, double edge_width, double second_value,
                                              const double direction[2], uint32_t flag);
/* The first point in array order with the identifier; null (nothing registered) when none. */
PLANO_API XSplineControlPoint *pXSplineGetControlPoint(const XSpline *curve, uint32_t identifier);

/* F(u, p) and, into each non-null pointer, dF/du, dF/dp, d2F/du2 and d2F/du dp. */
PLANO_API double dXSplineBlender(double p, double u, double *dF_du, double *dF_dp, double *d2F_du2,
                                 double *d2F_du_dp);
/* The weighted mean of up to four points, point i weighted by F(ui, pi); null points are
 * left out. sum (when given) receives the weighted sum of their edge widths, not divided.
 * A weight sum of exactly 0 fails with code 18. */
PLANO_API Plx_Bool bXSplineComputeVertex(const XSplineControlPoint *P0, double p0, double u0,
                                         const XSplineControlPoint *P1, double p1, double u1,
                                         const XSplineControlPoint *P2, double p2, double u2,
                                         const XSplineControlPoint *P3, double p3, double u3, double vertex[2],
                                         double *sum);
/* The curve position at point (its neighbours weighted by F(s/(1 + s), 2(1 + s)^2)). */
PLANO_API Plx_Bool bXSplineControlPointVertex(const XSplineControlPoint *previous, const XSplineControlPoint *point,
                                              const XSplineControlPoint *next, double vertex[2]);
/* The curve position halfway along the span from P1 to P2. */
PLANO_API Plx_Bool bXSplineControlPointMidpoint(const XSplineControlPoint *P0, const XSplineControlPoint *P1,
                                                const XSplineControlPoint *P2, const XSplineControlPoint *P3,
                                                double vertex[2]);

/* The six Bernstein coefficients over tau in [0, 1] of the quintic
 *     sum over i < m of values[i] * F(intercepts[i] + slopes[i] * tau, p[i]). */
PLANO_API Plx_Bool bXSplineComputeBernsteinCoefficients(const double *values, const double *slopes,
                                                        const double *intercepts, const double *p, uint32_t m,
                                                        double coefficients[6]);
/* Evaluates one rational quintic piece at t: coefficients are 6 rows of (X, Y, Z, W).
 * vertex = (X, Y)/W; extra (when both extra pointers are given) = the plain quintic of the
 * six extra coefficients; tangent = the unit derivative; second = the curvature vector, the
 * part of the second derivative across the tangent divided by the squared speed. Where the
 * derivative vanishes, tangent is that zero derivative and second is (0, 0). A denominator
 * of exactly 0 fails with code 18. */
PLANO_API Plx_Bool bXSplineBezierVertex(const double *coefficients, const double *extra_coefficients, double t,
                                        double vertex[2], double tangent[2], double second[2], double *extra);

/* Builds cache for the span from P1 to P2 (P0 before it, P3 after it) of a curve whose
 * spans are L long in T: its pieces in Bernstein form over tau, their bounds and widths.
 * L not above 0 (or not finite) fails with code 32. */
PLANO_API Plx_Bool bInitControlStruct(XSplineControlStruct *cache, const XSplineControlPoint *P0,
                                      const XSplineControlPoint *P1, const XSplineControlPoint *P2,
                                      const XSplineControlPoint *P3, double L);
/* Marks the cache empty. */
PLANO_API void vXSplineInitControlStruct(XSplineControlStruct *cache);
/* Position, unit tangent, curvature vector and edge width at curve parameter T. The cache
 * is keyed by the address of the span's first point and the curve's point count: reinitialise
 * it when points are moved or replaced. T outside [0, 1] fails with code 7. The edge width is
 * interpolated straight between the span's two points. */
PLANO_API Plx_Bool bXSplineComputeVertexSimple(const XSpline *curve, double T, double vertex[2], double tangent[2],
                                               double second[2], double *width, XSplineControlStruct *cache);

/* Writes the unit normal of a point of a closed curve from the edges to its neighbours
 * (a random direction when both neighbours lie on it). An open curve fails with code 7, an
 * index past the end with code 32, neighbours in exactly the same direction with code 18. */
PLANO_API Plx_Bool bXSplineComputeNormal(XSpline *curve, uint32_t index);
/* Corner widening factor at (x0, y0) between (x1, y1) and (x2, y2): 1/|sin(theta/2)| of the
 * corner angle theta, capped at 3; 1 when a neighbour coincides with the corner or theta is
 * 0. */
PLANO_API double dSplineEdgeScaleFromPoints(double x0, double y0, double x1, double y1, double x2, double y2);
/* The same at point index with its neighbours (wrapping on a closed curve; 1 at the ends of
 * an open one), in single precision. An index past the end registers code 7 and returns
 * FLT_MAX. */
PLANO_API double dXSplineEdgeScale(const XSpline *curve, uint32_t index);
/* Box of the control points (not of the curve). An empty curve gives (0, 0) twice and
 * returns 0 without an error record. */
PLANO_API Plx_Bool bXSplineBoundingBox(const XSpline *curve, double min[2], double max[2]);
/* T prepared for display, usable as a feathered fill's T function: 0 when flag is not above
 * 0.5, else T kept strictly inside (0, 1). */
PLANO_API float fXSplineShowTValues(float flag, float T);

#ifdef __cplusplus
}
#endif

#endif
