// The X-spline blending function and the curve positions made by blending control points
// directly: any four weighted points, a control point's own position and a span's midpoint.
#include "common/internal.hpp"
#include "spline/spline_internal.hpp"

using plano::spline::check_not_null;

namespace plano::spline {

namespace {

double blend(double u, double p) { return dXSplineBlender(p, u, nullptr, nullptr, nullptr, nullptr); }

void span_weights(const Span &span, double t, double weights[4])
{
    // The shape of each span end sets how far its neighbours reach into the span.
    const double s1 = shape_of(*span.p[1]), s2 = shape_of(*span.p[2]);
    const double a1 = 1.0 + s1, a2 = 1.0 + s2;
    weights[0] = t < s1 ? blend((s1 - t) / a1, blend_p(s1)) : 0.0;
    weights[1] = blend((a2 - t) / a2, blend_p(s2));
    weights[2] = blend((t + s1) / a1, blend_p(s1));
    weights[3] = t > 1.0 - s2 ? blend((t - 1.0 + s2) / a2, blend_p(s2)) : 0.0;
}

}  // namespace

Span span_of(const XSpline &curve, uint32_t k)
{
    const XSplineControlPoint *points = curve.control_points;
    const int64_t n = curve.count;
    auto at = [&](int64_t i) {
        if (curve.open) return &points[i < 0 ? 0 : i >= n ? n - 1 : i];
        return &points[((i % n) + n) % n];
    };
    return Span{{at(int64_t(k) - 1), at(k), at(int64_t(k) + 1), at(int64_t(k) + 2)}};
}

void span_point(const Span &span, double t, double vertex[2])
{
    double w[4];
    span_weights(span, t, w);
    // Offsets from the span's start, so that a corner point with no neighbour weight comes
    // back exactly.
    const XSplineControlPoint &o = *span.p[1];
    double sum = 0.0, dx = 0.0, dy = 0.0;
    for (int i = 0; i < 4; ++i) {
        sum += w[i];
        dx += w[i] * (span.p[i]->x - o.x);
        dy += w[i] * (span.p[i]->y - o.y);
    }
    vertex[0] = o.x + dx / sum;
    vertex[1] = o.y + dy / sum;
}

}  // namespace plano::spline

extern "C" {

PLANO_API double dXSplineBlender(double p, double u, double *dF_du, double *dF_dp, double *d2F_du2,
                                 double *d2F_du_dp)
{
    const double c5 = 6.0 - p, c4 = 2.0 * p - 15.0, c3 = 10.0 - p;
    const double u2 = u * u, u3 = u2 * u;
    if (dF_du != nullptr) *dF_du = u2 * ((5.0 * c5 * u + 4.0 * c4) * u + 3.0 * c3);
    if (dF_dp != nullptr) *dF_dp = -u3 * (1.0 - u) * (1.0 - u);
    if (d2F_du2 != nullptr) *d2F_du2 = u * ((20.0 * c5 * u + 12.0 * c4) * u + 6.0 * c3);
    if (d2F_du_dp != nullptr) *d2F_du_dp = (5.0 * u - 3.0) * u2 * (1.0 - u);
    return u3 * ((c5 * u + c4) * u + c3);
}

PLANO_API Plx_Bool bXSplineComputeVertex(const XSplineControlPoint *P0, double p0, double u0,
                                         const XSplineControlPoint *P1, double p1, double u1,
                                         const XSplineControlPoint *P2, double p2, double u2,
                                         const XSplineControlPoint *P3, double p3, double u3, double vertex[2],
                                         double *sum)
{
    if (!check_not_null({vertex})) return 0;
    const XSplineControlPoint *points[4] = {P0, P1, P2, P3};
    const double p[4] = {p0, p1, p2, p3}, u[4] = {u0, u1, u2, u3};
    double weight = 0.0, x = 0.0, y = 0.0, width = 0.0;
    for (int i = 0; i < 4; ++i) {
        if (points[i] == nullptr) continue;
        const double f = dXSplineBlender(p[i], u[i], nullptr, nullptr, nullptr, nullptr);
        weight += f;
        x += f * points[i]->x;
        y += f * points[i]->y;
        width += f * points[i]->edge_width;
    }
    if (weight == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "zero weight sum", 0);
        return 0;
    }
    vertex[0] = x / weight;
    vertex[1] = y / weight;
    if (sum != nullptr) *sum = width;
    return 1;
}

PLANO_API Plx_Bool bXSplineControlPointVertex(const XSplineControlPoint *previous, const XSplineControlPoint *point,
                                              const XSplineControlPoint *next, double vertex[2])
{
    if (!check_not_null({previous, point, next, vertex})) return 0;
    // At the start of the span from point to next the point after never reaches in.
    plano::spline::span_point(plano::spline::Span{{previous, point, next, next}}, 0.0, vertex);
    return 1;
}

PLANO_API Plx_Bool bXSplineControlPointMidpoint(const XSplineControlPoint *P0, const XSplineControlPoint *P1,
                                                const XSplineControlPoint *P2, const XSplineControlPoint *P3,
                                                double vertex[2])
{
    if (!check_not_null({P0, P1, P2, P3, vertex})) return 0;
    plano::spline::span_point(plano::spline::Span{{P0, P1, P2, P3}}, 0.5, vertex);
    return 1;
}

}  // extern "C"
