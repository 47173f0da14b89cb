// Fixed-size matrix and vector algebra, written once over the scalar type and the sizes.
//
// Matrices are plain row-major arrays T[R][C] (the m member of the public records); vectors
// are arrays T[N]. Every operation tolerates its output aliasing an input: results are built
// in a local and copied out at the end. Decisions that can fail return a Status instead of
// registering errors, so the exported wrappers report under their own names.
#ifndef PELLUX_SRC_FIXED_ALGEBRA_HPP
#define PELLUX_SRC_FIXED_ALGEBRA_HPP

#include <cmath>
#include <cstring>
#include <type_traits>
#include <utility>

#include "pellux/error.h"

namespace plx::fixed {

enum Status : int { kOk = 0, kSingular = PLX_ERROR_DIVISION_BY_ZERO, kNotPositive = PLX_ERROR_ILLEGAL_ARGUMENT,
                    kNoConvergence = PLX_ERROR_NO_CONVERGENCE };

template <class T, int R, int C>
using Mat = T[R][C];

// Loads the N equal scalar fields of a public vector record into an array and back. The
// records are standard-layout structs of N scalars, so they have exactly the array's bytes.
template <class T, int N, class V>
inline void load(const V &v, T (&a)[N])
{
    static_assert(sizeof(V) == sizeof(T) * N && std::is_standard_layout_v<V>);
    std::memcpy(a, &v, sizeof a);
}
template <class T, int N, class V>
inline void store(const T (&a)[N], V &v)
{
    static_assert(sizeof(V) == sizeof(T) * N && std::is_standard_layout_v<V>);
    std::memcpy(&v, a, sizeof a);
}

template <class T, int R, int C>
inline void copy(const T (&a)[R][C], T (&b)[R][C])
{
    std::memcpy(b, a, sizeof b);
}

template <class T, int N>
inline void identity(T (&a)[N][N])
{
    for (int r = 0; r < N; ++r)
        for (int c = 0; c < N; ++c) a[r][c] = r == c ? T(1) : T(0);
}

template <class T, int R, int C>
inline void transpose(const T (&a)[R][C], T (&at)[C][R])
{
    T t[C][R];
    for (int r = 0; r < R; ++r)
        for (int c = 0; c < C; ++c) t[c][r] = a[r][c];
    std::memcpy(at, t, sizeof t);
}

template <class T, int R, int C>
inline void scale(const T (&a)[R][C], T s, T (&out)[R][C])
{
    for (int r = 0; r < R; ++r)
        for (int c = 0; c < C; ++c) out[r][c] = a[r][c] * s;
}

template <class T, int R, int C>
inline void add(const T (&a)[R][C], const T (&b)[R][C], T (&out)[R][C])
{
    for (int r = 0; r < R; ++r)
        for (int c = 0; c < C; ++c) out[r][c] = a[r][c] + b[r][c];
}

template <class T, int R, int C>
inline void sub(const T (&a)[R][C], const T (&b)[R][C], T (&out)[R][C])
{
    for (int r = 0; r < R; ++r)
        for (int c = 0; c < C; ++c) out[r][c] = a[r][c] - b[r][c];
}

template <class T, int R, int K, int C>
inline void multiply(const T (&a)[R][K], const T (&b)[K][C], T (&ab)[R][C])
{
    T t[R][C];
    for (int r = 0; r < R; ++r)
        for (int c = 0; c < C; ++c) {
            T s = 0;
            for (int k = 0; k < K; ++k) s += a[r][k] * b[k][c];
            t[r][c] = s;
        }
    std::memcpy(ab, t, sizeof t);
}

template <class T, int R, int C>
inline void mult_vec(const T (&a)[R][C], const T (&x)[C], T (&y)[R])
{
    T t[R];
    for (int r = 0; r < R; ++r) {
        T s = 0;
        for (int c = 0; c < C; ++c) s += a[r][c] * x[c];
        t[r] = s;
    }
    std::memcpy(y, t, sizeof t);
}

template <class T, int R, int C>
inline void tmult_vec(const T (&a)[R][C], const T (&x)[R], T (&y)[C])
{
    T t[C];
    for (int c = 0; c < C; ++c) {
        T s = 0;
        for (int r = 0; r < R; ++r) s += a[r][c] * x[r];
        t[c] = s;
    }
    std::memcpy(y, t, sizeof t);
}

template <class T, int R, int C>
inline T frobenius(const T (&a)[R][C])
{
    double s = 0;
    for (int r = 0; r < R; ++r)
        for (int c = 0; c < C; ++c) s += double(a[r][c]) * double(a[r][c]);
    return T(std::sqrt(s));
}

// Determinant, accumulated in double whatever T is. 2x2 and 3x3 by their closed forms, 4x4 by
// expansion in 2x2 minors of the top and bottom row pairs (Laplace).
template <int N, class T>
inline double determinant(const T (&a)[N][N])
{
    auto m = [&](int r, int c) { return double(a[r][c]); };
    if constexpr (N == 2) {
        return m(0, 0) * m(1, 1) - m(0, 1) * m(1, 0);
    } else if constexpr (N == 3) {
        return m(0, 0) * (m(1, 1) * m(2, 2) - m(1, 2) * m(2, 1)) -
               m(0, 1) * (m(1, 0) * m(2, 2) - m(1, 2) * m(2, 0)) +
               m(0, 2) * (m(1, 0) * m(2, 1) - m(1, 1) * m(2, 0));
    } else {
        static_assert(N == 4);
        auto top = [&](int i, int j) { return m(0, i) * m(1, j) - m(0, j) * m(1, i); };
        auto bot = [&](int i, int j) { return m(2, i) * m(3, j) - m(2, j) * m(3, i); };
        return top(0, 1) * bot(2, 3) - top(0, 2) * bot(1, 3) + top(0, 3) * bot(1, 2) +
               top(1, 2) * bot(0, 3) - top(1, 3) * bot(0, 2) + top(2, 3) * bot(0, 1);
    }
}

// Relative size of a pivot of a row-equilibrated matrix below which the matrix counts as
// singular: at that level the pivot is rounding noise (an exactly singular matrix rarely
// gives an exact zero in floating point) and the inverse would carry no correct digit.
constexpr double kSingularPivot = 64.0 * 2.220446049250313e-16;

// Inverse by Gauss-Jordan elimination with partial pivoting, in double, on the matrix with
// each row scaled to a largest magnitude of 1 (so the singularity test does not depend on
// how the rows are scaled). A zero row, a pivot at rounding level or a non-finite result is
// a singular matrix; the output is then left untouched.
template <int N, class T>
inline Status invert(const T (&a)[N][N], T (&out)[N][N])
{
    double w[N][2 * N];
    for (int r = 0; r < N; ++r) {
        double big = 0;
        for (int c = 0; c < N; ++c) big = std::fmax(big, std::fabs(double(a[r][c])));
        if (!(big > 0.0) || !std::isfinite(big)) return kSingular;
        double s = 1.0 / big;
        for (int c = 0; c < N; ++c) {
            w[r][c] = double(a[r][c]) * s;
            w[r][N + c] = r == c ? s : 0.0;  // the inverse of the scaled matrix, times the scale
        }
    }
    for (int k = 0; k < N; ++k) {
        int p = k;
        for (int r = k + 1; r < N; ++r)
            if (std::fabs(w[r][k]) > std::fabs(w[p][k])) p = r;
        if (p != k)
            for (int c = 0; c < 2 * N; ++c) std::swap(w[p][c], w[k][c]);
        double pivot = w[k][k];
        if (!(std::fabs(pivot) > kSingularPivot)) return kSingular;
        double inv = 1.0 / pivot;
        for (int c = 0; c < 2 * N; ++c) w[k][c] *= inv;
        for (int r = 0; r < N; ++r) {
            if (r == k) continue;
            double f = w[r][k];
            if (f == 0.0) continue;
            for (int c = 0; c < 2 * N; ++c) w[r][c] -= f * w[k][c];
        }
    }
    T t[N][N];
    for (int r = 0; r < N; ++r)
        for (int c = 0; c < N; ++c) {
            t[r][c] = T(w[r][N + c]);
            if (!std::isfinite(t[r][c])) return kSingular;
        }
    std::memcpy(out, t, sizeof t);
    return kOk;
}

// Inverse of the affine map x -> A x + t held as [A | t] (a 3x3 matrix with last row 0 0 1):
// [A^-1 | -A^-1 t].
template <class T>
inline Status invert_affine(const T (&a)[2][3], T (&out)[2][3])
{
    double det = double(a[0][0]) * a[1][1] - double(a[0][1]) * a[1][0];
    double r0 = std::fmax(std::fabs(double(a[0][0])), std::fabs(double(a[0][1])));
    double r1 = std::fmax(std::fabs(double(a[1][0])), std::fabs(double(a[1][1])));
    // The same relative test as for the square inverses, on the rows of the 2x2 part.
    if (!(std::fabs(det) > kSingularPivot * r0 * r1) || !std::isfinite(det)) return kSingular;
    double i00 = a[1][1] / det, i01 = -a[0][1] / det, i10 = -a[1][0] / det, i11 = a[0][0] / det;
    double tx = a[0][2], ty = a[1][2];
    T t[2][3] = {{T(i00), T(i01), T(-(i00 * tx + i01 * ty))}, {T(i10), T(i11), T(-(i10 * tx + i11 * ty))}};
    for (auto &row : t)
        for (T v : row)
            if (!std::isfinite(v)) return kSingular;
    std::memcpy(out, t, sizeof t);
    return kOk;
}

// Composition of two affine maps held as 2x3 matrices: (A o B)(x) = A (B x).
template <class T>
inline void compose_affine(const T (&a)[2][3], const T (&b)[2][3], T (&out)[2][3])
{
    T t[2][3];
    for (int r = 0; r < 2; ++r) {
        for (int c = 0; c < 3; ++c) t[r][c] = a[r][0] * b[0][c] + a[r][1] * b[1][c];
        t[r][2] += a[r][2];
    }
    std::memcpy(out, t, sizeof t);
}

// Cholesky factor L (lower triangular, L L^T = A) of a symmetric matrix given by its lower
// triangle. Fails when a pivot is not positive (or not finite); the output is then untouched.
template <int N, class T>
inline Status cholesky(const T (&a)[N][N], T (&out)[N][N])
{
    double l[N][N] = {};
    for (int j = 0; j < N; ++j) {
        double d = a[j][j];
        for (int k = 0; k < j; ++k) d -= l[j][k] * l[j][k];
        if (!(d > 0.0) || !std::isfinite(d)) return kNotPositive;
        double ljj = std::sqrt(d);
        l[j][j] = ljj;
        for (int i = j + 1; i < N; ++i) {
            double s = a[i][j];
            for (int k = 0; k < j; ++k) s -= l[i][k] * l[j][k];
            l[i][j] = s / ljj;
        }
    }
    for (int r = 0; r < N; ++r)
        for (int c = 0; c < N; ++c) out[r][c] = T(l[r][c]);
    return kOk;
}

// Symmetric eigen-decomposition of the matrix given by its lower triangle (defined in
// fixed.cpp through Eigen): eigenvalues ascending, eigenvectors as the matching columns of
// vectors, each unit length with its largest-magnitude component positive.
template <int N, class T>
Status symmetric_eigen(const T (&a)[N][N], T (&values)[N], T (&vectors)[N][N]);

template <class T, int N>
inline T dot(const T (&a)[N], const T (&b)[N])
{
    T s = 0;
    for (int i = 0; i < N; ++i) s += a[i] * b[i];
    return s;
}

}  // namespace plx::fixed

#endif
