// The rational quintic form of an X-spline span: Bernstein coefficients of blended terms,
// evaluation of one piece with its derivatives, and evaluation of the curve at any T through
// the span cache.
#include <cmath>

#include "common/internal.hpp"
#include "spline/spline_internal.hpp"

using plano::spline::check_not_null;

namespace {

constexpr double kBinomial[6][6] = {{1, 0, 0, 0, 0, 0}, {1, 1, 0, 0, 0, 0}, {1, 2, 1, 0, 0, 0},
                                    {1, 3, 3, 1, 0, 0}, {1, 4, 6, 4, 1, 0}, {1, 5, 10, 10, 5, 1}};

}  // namespace

namespace plano::spline {

void blend_term_coefficients(double intercept, double slope, double p, double coefficients[6])
{
    // Expand F(a + b tau) = sum over m = 3..5 of f_m (a + b tau)^m into powers of tau, then
    // change to the Bernstein basis (c_j = sum over k <= j of C(j, k) / C(5, k) q_k).
    const double f[6] = {0.0, 0.0, 0.0, 10.0 - p, 2.0 * p - 15.0, 6.0 - p};
    double a_power[6] = {1.0}, b_power[6] = {1.0};
    for (int i = 1; i < 6; ++i) {
        a_power[i] = a_power[i - 1] * intercept;
        b_power[i] = b_power[i - 1] * slope;
    }
    double q[6] = {};
    for (int m = 3; m < 6; ++m)
        for (int k = 0; k <= m; ++k) q[k] += f[m] * kBinomial[m][k] * a_power[m - k] * b_power[k];
    for (int j = 0; j < 6; ++j) {
        double c = 0.0;
        for (int k = 0; k <= j; ++k) c += kBinomial[j][k] / kBinomial[5][k] * q[k];
        coefficients[j] = c;
    }
}

void build_span_pieces(const Span &span, double L, XSplineControlStruct *cache)
{
    const XSplineControlPoint &P1 = *span.p[1], &P2 = *span.p[2];
    const double s1 = shape_of(P1), s2 = shape_of(P2);
    const double a1 = 1.0 + s1, a2 = 1.0 + s2;
    // Where P0 stops reaching and where P3 starts; between them the set of weights is fixed.
    const double p0_stops = a1 * L, p3_starts = (2.0 - s2) * L;
    const double b1 = std::fmin(p0_stops, p3_starts), b2 = std::fmax(p0_stops, p3_starts);

    // u of each point as an affine function of tau, and its p.
    const double intercept[4] = {1.0, (2.0 + s2) / a2, -(1.0 - s1) / a1, -(2.0 - s2) / a2};
    const double slope[4] = {-1.0 / (a1 * L), -1.0 / (a2 * L), 1.0 / (a1 * L), 1.0 / (a2 * L)};
    const double p[4] = {blend_p(s1), blend_p(s2), blend_p(s1), blend_p(s2)};
    double term[4][6];
    for (int i = 0; i < 4; ++i) blend_term_coefficients(intercept[i], slope[i], p[i], term[i]);

    cache->length = L;
    cache->length_squared = L * L;
    const double start[3] = {L, b1, b2}, end[3] = {b1, b2, 2.0 * L};
    for (int piece = 0; piece < 3; ++piece) {
        cache->piece_start[piece] = start[piece];
        cache->piece_end[piece] = end[piece];
        cache->widths[piece][0] = P1.edge_width;
        cache->widths[piece][1] = P2.edge_width;
        cache->widths[piece][2] = L;
        const double mid = 0.5 * (start[piece] + end[piece]);
        const bool nonempty = start[piece] < end[piece];
        const bool active[4] = {nonempty && mid < p0_stops, nonempty, nonempty, nonempty && mid > p3_starts};
        for (int j = 0; j < 6; ++j) {
            double *row = cache->coefficients[piece][j];
            row[0] = row[1] = row[2] = row[3] = 0.0;
            for (int i = 0; i < 4; ++i) {
                if (!active[i]) continue;
                row[0] += span.p[i]->x * term[i][j];
                row[1] += span.p[i]->y * term[i][j];
                row[3] += term[i][j];
            }
        }
    }
}

int piece_holding(const XSplineControlStruct &cache, double tau)
{
    int last = -1;
    for (int piece = 0; piece < 3; ++piece) {
        if (!(cache.piece_start[piece] < cache.piece_end[piece])) continue;
        if (tau < cache.piece_end[piece]) return piece;
        last = piece;
    }
    return last;
}

}  // namespace plano::spline

extern "C" {

PLANO_API Plx_Bool bXSplineComputeBernsteinCoefficients(const double *values, const double *slopes,
                                                        const double *intercepts, const double *p, uint32_t m,
                                                        double coefficients[6])
{
    if (!check_not_null({coefficients}) || (m > 0 && !check_not_null({values, slopes, intercepts, p}))) return 0;
    for (int j = 0; j < 6; ++j) coefficients[j] = 0.0;
    for (uint32_t i = 0; i < m; ++i) {
        double term[6];
        plano::spline::blend_term_coefficients(intercepts[i], slopes[i], p[i], term);
        for (int j = 0; j < 6; ++j) coefficients[j] += values[i] * term[j];
    }
    return 1;
}

PLANO_API Plx_Bool bXSplineBezierVertex(const double *coefficients, const double *extra_coefficients, double t,
                                        double vertex[2], double tangent[2], double second[2], double *extra)
{
    if (!check_not_null({coefficients, vertex})) return 0;
    // Bernstein bases of degrees 5, 4 and 3 at t; the derivatives are the lower-degree
    // forms of the forward differences of the coefficients.
    const double s = 1.0 - t;
    double tp[6] = {1.0}, sp[6] = {1.0};
    for (int i = 1; i < 6; ++i) {
        tp[i] = tp[i - 1] * t;
        sp[i] = sp[i - 1] * s;
    }
    double b5[6], b4[5], b3[4];
    for (int j = 0; j < 6; ++j) b5[j] = kBinomial[5][j] * tp[j] * sp[5 - j];
    for (int j = 0; j < 5; ++j) b4[j] = kBinomial[4][j] * tp[j] * sp[4 - j];
    for (int j = 0; j < 4; ++j) b3[j] = kBinomial[3][j] * tp[j] * sp[3 - j];
    auto c = [coefficients](int j, int component) { return coefficients[4 * j + component]; };
    double value[4] = {}, d1[4] = {}, d2[4] = {};
    for (int component : {0, 1, 3}) {
        for (int j = 0; j < 6; ++j) value[component] += b5[j] * c(j, component);
        for (int j = 0; j < 5; ++j) d1[component] += b4[j] * (c(j + 1, component) - c(j, component));
        for (int j = 0; j < 4; ++j)
            d2[component] += b3[j] * (c(j + 2, component) - 2.0 * c(j + 1, component) + c(j, component));
        d1[component] *= 5.0;
        d2[component] *= 20.0;
    }
    const double W = value[3];
    if (W == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "zero denominator", 0);
        return 0;
    }
    vertex[0] = value[0] / W;
    vertex[1] = value[1] / W;
    if (extra_coefficients != nullptr && extra != nullptr) {
        double e = 0.0;
        for (int j = 0; j < 6; ++j) e += b5[j] * extra_coefficients[j];
        *extra = e;
    }
    if (tangent == nullptr && second == nullptr) return 1;
    // Derivatives of N / W: D1 = (N' - W' v) / W, D2 = (N'' - W'' v - 2 W' D1) / W.
    double D1[2], D2[2];
    for (int i = 0; i < 2; ++i) {
        D1[i] = (d1[i] - d1[3] * vertex[i]) / W;
        D2[i] = (d2[i] - d2[3] * vertex[i] - 2.0 * d1[3] * D1[i]) / W;
    }
    const double speed2 = D1[0] * D1[0] + D1[1] * D1[1], speed = std::sqrt(speed2);
    if (tangent != nullptr) {
        tangent[0] = speed > 0.0 ? D1[0] / speed : D1[0];
        tangent[1] = speed > 0.0 ? D1[1] / speed : D1[1];
    }
    if (second != nullptr) {
        if (speed2 > 0.0) {
            // The part across the tangent over the squared speed: the curvature vector, the
            // same whatever the parameter's scale.
            const double along = (D1[0] * D2[0] + D1[1] * D2[1]) / speed2;
            second[0] = (D2[0] - along * D1[0]) / speed2;
            second[1] = (D2[1] - along * D1[1]) / speed2;
        } else {
            second[0] = second[1] = 0.0;
        }
    }
    return 1;
}

PLANO_API Plx_Bool bInitControlStruct(XSplineControlStruct *cache, const XSplineControlPoint *P0,
                                      const XSplineControlPoint *P1, const XSplineControlPoint *P2,
                                      const XSplineControlPoint *P3, double L)
{
    if (!check_not_null({cache, P0, P1, P2, P3})) return 0;
    if (!(L > 0.0 && std::isfinite(L))) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "span length not positive", 0);
        return 0;
    }
    plano::spline::build_span_pieces(plano::spline::Span{{P0, P1, P2, P3}}, L, cache);
    cache->span_start = P1;
    return 1;
}

PLANO_API void vXSplineInitControlStruct(XSplineControlStruct *cache)
{
    if (cache == nullptr) return;
    cache->span_start = nullptr;
    cache->length = cache->length_squared = 0.0;
}

PLANO_API Plx_Bool bXSplineComputeVertexSimple(const XSpline *curve, double T, double vertex[2], double tangent[2],
                                               double second[2], double *width, XSplineControlStruct *cache)
{
    if (!plano::spline::check_curve(curve) || !check_not_null({vertex, cache})) return 0;
    if (!(T >= 0.0 && T <= 1.0)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "T outside [0, 1]", 0);
        return 0;
    }
    const uint32_t n = curve->count;
    const double L = 1.0 / n;
    if (T == 1.0) T = curve->open ? 0.99999999 : 0.0;
    // Rounding may carry T/L just below 1 up to n: that T belongs to the last span.
    uint32_t k = uint32_t(T / L);
    if (k >= n) k = n - 1;
    const plano::spline::Span span = plano::spline::span_of(*curve, k);
    if ((cache->span_start != span.p[1] || cache->length != L) &&
        !bInitControlStruct(cache, span.p[0], span.p[1], span.p[2], span.p[3], L)) {
        PLX_ERR_PASS();
        return 0;
    }
    double tau = T - (double(k) - 1.0) * L;
    tau = std::fmax(cache->piece_start[0], std::fmin(tau, cache->piece_end[2]));
    const int piece = plano::spline::piece_holding(*cache, tau);
    if (piece < 0) {
        PLX_ERR_START(PLX_ERROR_OUTSIDE_RANGE, "no piece holds the parameter", 0);
        return 0;
    }
    if (!bXSplineBezierVertex(&cache->coefficients[piece][0][0], nullptr, tau, vertex, tangent, second, nullptr)) {
        PLX_ERR_PASS();
        return 0;
    }
    if (width != nullptr) {
        const double *w = cache->widths[piece];
        *width = w[0] + (tau / w[2] - 1.0) * (w[1] - w[0]);
    }
    return 1;
}

}  // extern "C"
