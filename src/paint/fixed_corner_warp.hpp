// The fixed-corner warp in normalised image coordinates, its Jacobian, its derivatives with
// respect to the twelve coefficients and its Newton inverse, written once over the scalar
// type so double and single-precision cameras share them.
#ifndef PLANO_SRC_PAINT_FIXED_CORNER_WARP_HPP
#define PLANO_SRC_PAINT_FIXED_CORNER_WARP_HPP

#include <cmath>
#include <type_traits>

#include "pellux/camera.h"
#include "pellux/error.h"

namespace plano::fcw {

// Newton steps stop when |dx| + |dy| falls below this (normalised units); single precision
// cannot resolve much below 1e-7 relative, so it stops earlier.
template <class S>
constexpr S step_tolerance()
{
    return std::is_same_v<S, float> ? S(1e-4) : S(1e-7);
}
// A converged solve has run at least this many steps; more than the limit is a failure.
constexpr int kMinIterations = 6;
constexpr int kMaxIterations = 100;

// Coefficient indices of the six terms in x' and in y' (k2, k4, k5, k7, k9, k10 and k1, k3,
// k6, k8, k11, k12); both rows share the same six basis functions.
constexpr int kXTerms[6] = {1, 3, 4, 6, 8, 9};
constexpr int kYTerms[6] = {0, 2, 5, 7, 10, 11};

template <class S>
struct Point {
    S x, y;
};

// 2x2 matrix, row-major.
template <class S>
struct Jac {
    S m[2][2];
    S det() const { return m[0][0] * m[1][1] - m[0][1] * m[1][0]; }
};

template <class S>
bool all_zero(const S *k)
{
    for (int i = 0; i < PLX_CAMERA_MAX_COEFFS; ++i)
        if (k[i] != S(0)) return false;
    return true;
}

// The six basis functions at (x, y): 4 b (0.5 - x), 4 b (x + 0.5), 4 a (0.5 - y),
// 4 a (y + 0.5), a x, b y. x' - x and y' - y are their dot products with the kXTerms and kYTerms
// coefficients, which is also why they are the coefficient derivatives.
template <class S>
void basis(S x, S y, S g[6])
{
    const S a = S(0.25) - x * x, b = S(0.25) - y * y;
    g[0] = S(4) * b * (S(0.5) - x);
    g[1] = S(4) * b * (x + S(0.5));
    g[2] = S(4) * a * (S(0.5) - y);
    g[3] = S(4) * a * (y + S(0.5));
    g[4] = a * x;
    g[5] = b * y;
}

// Forward warp of (x, y); with J given also its Jacobian d(x', y')/d(x, y).
template <class S>
Point<S> forward(const S *k, S x, S y, Jac<S> *J = nullptr)
{
    const S a = S(0.25) - x * x, b = S(0.25) - y * y;
    const S px = x + S(0.5), mx = S(0.5) - x, py = y + S(0.5), my = S(0.5) - y;
    // Edge displacements interpolated along the vertical (e*) and horizontal (f*) edges.
    const S ex = px * k[3] + mx * k[1], ey = px * k[2] + mx * k[0];
    const S fx = py * k[6] + my * k[4], fy = py * k[7] + my * k[5];
    Point<S> out{x + S(4) * (b * ex + a * fx) + k[8] * x * a + k[9] * y * b,
                 y + S(4) * (b * ey + a * fy) + k[10] * x * a + k[11] * y * b};
    if (J != nullptr) {
        const S cx = S(0.25) - S(3) * x * x, cy = S(0.25) - S(3) * y * y;
        J->m[0][0] = S(4) * ((k[3] - k[1]) * b - S(2) * x * fx) + S(1) + k[8] * cx;
        J->m[0][1] = S(4) * ((k[6] - k[4]) * a - S(2) * y * ex) + k[9] * cy;
        J->m[1][0] = S(4) * ((k[2] - k[0]) * b - S(2) * x * fy) + k[10] * cx;
        J->m[1][1] = S(4) * ((k[7] - k[5]) * a - S(2) * y * ey) + S(1) + k[11] * cy;
    }
    return out;
}

// Newton iteration for the (x, y) whose forward warp is target, from start. Returns 0 or
// the failure code: 18 for a singular Jacobian, 27 past the iteration limit. A NaN step
// never converges, so it runs into the limit rather than stopping early.
template <class S>
int newton(const S *k, Point<S> target, Point<S> start, Point<S> &solution)
{
    Point<S> p = start;
    for (int iteration = 1;; ++iteration) {
        Jac<S> J;
        Point<S> w = forward(k, p.x, p.y, &J);
        const S rx = target.x - w.x, ry = target.y - w.y;
        const S d = J.det();
        if (d == S(0)) return PLX_ERROR_DIVISION_BY_ZERO;
        const S dx = (rx * J.m[1][1] - J.m[0][1] * ry) / d;
        const S dy = (J.m[0][0] * ry - J.m[1][0] * rx) / d;
        p.x += dx;
        p.y += dy;
        if (std::fabs(dx) + std::fabs(dy) < step_tolerance<S>() && iteration >= kMinIterations) {
            solution = p;
            return 0;
        }
        if (iteration > kMaxIterations) return PLX_ERROR_OUTSIDE_RANGE;
    }
}

// Inverse warp of target. A filled cache gives the first starting point; if that attempt
// fails, the solve restarts from target minus the warp's displacement there. On success the
// cache (when given) keeps input and the solution.
template <class S, class Vec3>
int inverse(const S *k, Point<S> target, Plx_PositionState *cache, const Vec3 &input,
            Point<S> &solution)
{
    int code = -1;
    if (all_zero(k)) {
        solution = target;
        code = 0;
    }
    if (code != 0 && cache != nullptr && cache->valid == 1)
        code = newton(k, target, Point<S>{S(cache->solution[0]), S(cache->solution[1])}, solution);
    if (code != 0) {
        Point<S> w = forward(k, target.x, target.y);
        code = newton(k, target, Point<S>{target.x - (w.x - target.x), target.y - (w.y - target.y)},
                      solution);
    }
    if (code == 0 && cache != nullptr) {
        cache->valid = 1;
        cache->point[0] = input.x;
        cache->point[1] = input.y;
        cache->point[2] = input.z;
        cache->solution[0] = solution.x;
        cache->solution[1] = solution.y;
        cache->solution[2] = 1.0;
    }
    return code;
}

}  // namespace plano::fcw

#endif
