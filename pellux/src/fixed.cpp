// Exported fixed-size algebra: thin wrappers that instantiate fixed_algebra.hpp per scalar
// type and size, plus the symmetric eigen-decomposition, which Eigen does for us.
#include <Eigen/Eigenvalues>
#include <cmath>
#include <limits>

#include "fixed_algebra.hpp"
#include "pellux/fixed.h"

namespace plx::fixed {

template <int N, class T>
Status symmetric_eigen(const T (&a)[N][N], T (&values)[N], T (&vectors)[N][N])
{
    Eigen::Matrix<double, N, N> m;
    for (int r = 0; r < N; ++r)
        for (int c = 0; c <= r; ++c) m(r, c) = m(c, r) = double(a[r][c]);
    if (!m.allFinite()) return kNoConvergence;
    Eigen::SelfAdjointEigenSolver<Eigen::Matrix<double, N, N>> solver(m);
    if (solver.info() != Eigen::Success) return kNoConvergence;
    const auto &v = solver.eigenvectors();
    for (int c = 0; c < N; ++c) {
        int big = 0;
        for (int r = 1; r < N; ++r)
            if (std::fabs(v(r, c)) > std::fabs(v(big, c))) big = r;
        double sign = v(big, c) < 0 ? -1.0 : 1.0;
        for (int r = 0; r < N; ++r) vectors[r][c] = T(sign * v(r, c));
        values[c] = T(solver.eigenvalues()(c));
    }
    return kOk;
}

}  // namespace plx::fixed

namespace {

namespace fx = plx::fixed;

// Reports a failed status under the exported function's name.
Plx_Bool report(fx::Status status, const char *function)
{
    if (status == fx::kOk) return PLX_TRUE;
    const char *message = status == fx::kSingular      ? "singular matrix"
                          : status == fx::kNotPositive ? "matrix not positive definite"
                                                       : "eigen-decomposition did not converge";
    PLX_ERR_START_AS(function, status, message, 0);
    return PLX_FALSE;
}

Plx_Bool null_argument(const char *function)
{
    PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
    return PLX_FALSE;
}

template <class T, int N, class V>
void vec_load(const V *v, T (&a)[N])
{
    fx::load<T, N>(*v, a);
}

template <class T>
constexpr T nan_v = std::numeric_limits<T>::quiet_NaN();

}  // namespace

#define PLX_NULL2(a, b) ((a) == nullptr || (b) == nullptr)
#define PLX_NULL3(a, b, c) ((a) == nullptr || (b) == nullptr || (c) == nullptr)

// One square size and precision: MAT/VEC are the record types, P the name stem (e.g. mat33f),
// S the symmetric stem (symmat33f), INV the inverse's exported name.
#define PLX_FIXED_SQUARE(N, T, MAT, VEC, P, S, INV)                                              \
    extern "C" {                                                                                \
    PLX_API void plx_##P##_ident_s(MAT *A)                                                      \
    {                                                                                           \
        if (A) fx::identity<T, N>(A->m);                                                        \
    }                                                                                           \
    PLX_API void plx_##P##_transpose_s(const MAT *A, MAT *At)                                   \
    {                                                                                           \
        if (!PLX_NULL2(A, At)) fx::transpose(A->m, At->m);                                      \
    }                                                                                           \
    PLX_API T plx_##P##_det_s(const MAT *A) { return A ? T(fx::determinant<N>(A->m)) : nan_v<T>; } \
    PLX_API T plx_##P##_Fnorm_s(const MAT *A) { return A ? fx::frobenius(A->m) : nan_v<T>; }     \
    PLX_API void plx_##P##_scale_s(const MAT *A, T s, MAT *sA)                                  \
    {                                                                                           \
        if (!PLX_NULL2(A, sA)) fx::scale(A->m, s, sA->m);                                       \
    }                                                                                           \
    PLX_API void plx_##P##_add_s(const MAT *A, const MAT *B, MAT *C)                            \
    {                                                                                           \
        if (!PLX_NULL3(A, B, C)) fx::add(A->m, B->m, C->m);                                     \
    }                                                                                           \
    PLX_API void plx_##P##_sub_s(const MAT *A, const MAT *B, MAT *C)                            \
    {                                                                                           \
        if (!PLX_NULL3(A, B, C)) fx::sub(A->m, B->m, C->m);                                     \
    }                                                                                           \
    PLX_API void plx_##P##_rmultm##N##N##_s(const MAT *A, const MAT *B, MAT *AB)                \
    {                                                                                           \
        if (!PLX_NULL3(A, B, AB)) fx::multiply(A->m, B->m, AB->m);                              \
    }                                                                                           \
    PLX_API void plx_##P##_multv##N##_s(const MAT *A, const VEC *x, VEC *Ax)                    \
    {                                                                                           \
        if (PLX_NULL3(A, x, Ax)) return;                                                        \
        T v[N];                                                                                 \
        fx::load<T, N>(*x, v);                                                                  \
        fx::mult_vec(A->m, v, v);                                                               \
        fx::store<T, N>(v, *Ax);                                                                \
    }                                                                                           \
    PLX_API void plx_##P##_tmultv##N##_s(const MAT *A, const VEC *x, VEC *Atx)                  \
    {                                                                                           \
        if (PLX_NULL3(A, x, Atx)) return;                                                       \
        T v[N];                                                                                 \
        fx::load<T, N>(*x, v);                                                                  \
        fx::tmult_vec(A->m, v, v);                                                              \
        fx::store<T, N>(v, *Atx);                                                               \
    }                                                                                           \
    PLX_API Plx_Bool INV(const MAT *A, MAT *Ainv)                                               \
    {                                                                                           \
        if (PLX_NULL2(A, Ainv)) return null_argument(__func__);                                 \
        return report(fx::invert<N>(A->m, Ainv->m), __func__);                                  \
    }                                                                                           \
    PLX_API Plx_Bool plx_##S##_cholesky(const MAT *A, MAT *L)                                   \
    {                                                                                           \
        if (PLX_NULL2(A, L)) return null_argument(__func__);                                    \
        return report(fx::cholesky<N>(A->m, L->m), __func__);                                   \
    }                                                                                           \
    PLX_API Plx_Bool plx_##S##_eigen(const MAT *A, VEC *values, MAT *vectors)                   \
    {                                                                                           \
        if (PLX_NULL3(A, values, vectors)) return null_argument(__func__);                      \
        T val[N], vec[N][N];                                                                    \
        fx::Status status = fx::symmetric_eigen<N>(A->m, val, vec);                             \
        if (status == fx::kOk) {                                                                \
            fx::store<T, N>(val, *values);                                                      \
            fx::copy(vec, vectors->m);                                                          \
        }                                                                                       \
        return report(status, __func__);                                                        \
    }                                                                                           \
    }

// Conversions between the double and float records of one shape.
#define PLX_FIXED_CONVERT(R, C, MAT, STEM)                                                      \
    extern "C" {                                                                                \
    PLX_API void plx_##STEM##f_from_##STEM(const MAT *A, MAT##_f *Af)                           \
    {                                                                                           \
        if (PLX_NULL2(A, Af)) return;                                                           \
        for (int r = 0; r < R; ++r)                                                             \
            for (int c = 0; c < C; ++c) Af->m[r][c] = float(A->m[r][c]);                        \
    }                                                                                           \
    PLX_API void plx_##STEM##_from_##STEM##f(const MAT##_f *Af, MAT *A)                         \
    {                                                                                           \
        if (PLX_NULL2(A, Af)) return;                                                           \
        for (int r = 0; r < R; ++r)                                                             \
            for (int c = 0; c < C; ++c) A->m[r][c] = double(Af->m[r][c]);                       \
    }                                                                                           \
    }

// Vectors of one size and precision.
#define PLX_FIXED_VECTOR(N, T, VEC, P)                                                          \
    extern "C" {                                                                                \
    PLX_API void plx_##P##_add_s(const VEC *a, const VEC *b, VEC *c)                            \
    {                                                                                           \
        if (PLX_NULL3(a, b, c)) return;                                                         \
        T x[N], y[N];                                                                           \
        fx::load<T, N>(*a, x);                                                                  \
        fx::load<T, N>(*b, y);                                                                  \
        for (int i = 0; i < N; ++i) x[i] += y[i];                                               \
        fx::store<T, N>(x, *c);                                                                 \
    }                                                                                           \
    PLX_API void plx_##P##_sub_s(const VEC *a, const VEC *b, VEC *c)                            \
    {                                                                                           \
        if (PLX_NULL3(a, b, c)) return;                                                         \
        T x[N], y[N];                                                                           \
        fx::load<T, N>(*a, x);                                                                  \
        fx::load<T, N>(*b, y);                                                                  \
        for (int i = 0; i < N; ++i) x[i] -= y[i];                                               \
        fx::store<T, N>(x, *c);                                                                 \
    }                                                                                           \
    PLX_API void plx_##P##_scale_s(const VEC *a, T s, VEC *c)                                   \
    {                                                                                           \
        if (PLX_NULL2(a, c)) return;                                                            \
        T x[N];                                                                                 \
        fx::load<T, N>(*a, x);                                                                  \
        for (int i = 0; i < N; ++i) x[i] *= s;                                                  \
        fx::store<T, N>(x, *c);                                                                 \
    }                                                                                           \
    PLX_API T plx_##P##_dot_s(const VEC *a, const VEC *b)                                       \
    {                                                                                           \
        if (PLX_NULL2(a, b)) return nan_v<T>;                                                   \
        T x[N], y[N];                                                                           \
        fx::load<T, N>(*a, x);                                                                  \
        fx::load<T, N>(*b, y);                                                                  \
        return fx::dot(x, y);                                                                   \
    }                                                                                           \
    PLX_API T plx_##P##_norm_s(const VEC *a)                                                    \
    {                                                                                           \
        if (a == nullptr) return nan_v<T>;                                                      \
        T x[N];                                                                                 \
        fx::load<T, N>(*a, x);                                                                  \
        double s = 0;                                                                           \
        for (int i = 0; i < N; ++i) s += double(x[i]) * double(x[i]);                           \
        return T(std::sqrt(s));                                                                 \
    }                                                                                           \
    }

PLX_FIXED_SQUARE(2, double, Plx_Matrix22, Plx_Vector2, mat22, symmat22, plx_mat22_invert_s)
PLX_FIXED_SQUARE(2, float, Plx_Matrix22_f, Plx_Vector2_f, mat22f, symmat22f, plx_mat22f_invert_s)
PLX_FIXED_SQUARE(3, double, Plx_Matrix33, Plx_Vector3, mat33, symmat33, plx_mat33_invert_s)
PLX_FIXED_SQUARE(3, float, Plx_Matrix33_f, Plx_Vector3_f, mat33f, symmat33f, plx_mat33f_invert)
PLX_FIXED_SQUARE(4, double, Plx_Matrix44, Plx_Vector4, mat44, symmat44, plx_mat44_invert_s)
PLX_FIXED_SQUARE(4, float, Plx_Matrix44_f, Plx_Vector4_f, mat44f, symmat44f, plx_mat44f_invert_s)

PLX_FIXED_CONVERT(2, 2, Plx_Matrix22, mat22)
PLX_FIXED_CONVERT(3, 3, Plx_Matrix33, mat33)
PLX_FIXED_CONVERT(4, 4, Plx_Matrix44, mat44)
PLX_FIXED_CONVERT(2, 3, Plx_Matrix23, mat23)

PLX_FIXED_VECTOR(2, double, Plx_Vector2, vec2)
PLX_FIXED_VECTOR(2, float, Plx_Vector2_f, vec2f)
PLX_FIXED_VECTOR(3, double, Plx_Vector3, vec3)
PLX_FIXED_VECTOR(3, float, Plx_Vector3_f, vec3f)
PLX_FIXED_VECTOR(4, double, Plx_Vector4, vec4)
PLX_FIXED_VECTOR(4, float, Plx_Vector4_f, vec4f)

// 2x3 affine maps and the cross product, per precision.
#define PLX_FIXED_AFFINE(T, SUF, F)                                                             \
    extern "C" {                                                                                \
    PLX_API void plx_mat23##F##_multv3_s(const Plx_Matrix23##SUF *A, const Plx_Vector3##SUF *x, \
                                         Plx_Vector2##SUF *Ax)                                  \
    {                                                                                           \
        if (PLX_NULL3(A, x, Ax)) return;                                                        \
        T v[3], r[2];                                                                           \
        fx::load<T, 3>(*x, v);                                                                  \
        fx::mult_vec(A->m, v, r);                                                               \
        fx::store<T, 2>(r, *Ax);                                                                \
    }                                                                                           \
    PLX_API void plx_mat23h##F##_multv2_s(const Plx_Matrix23##SUF *A, const Plx_Vector2##SUF *x, \
                                          Plx_Vector2##SUF *Ax)                                 \
    {                                                                                           \
        if (PLX_NULL3(A, x, Ax)) return;                                                        \
        T v[3] = {x->x, x->y, T(1)}, r[2];                                                      \
        fx::mult_vec(A->m, v, r);                                                               \
        fx::store<T, 2>(r, *Ax);                                                                \
    }                                                                                           \
    PLX_API void plx_mat23h##F##_rmultm23h_s(const Plx_Matrix23##SUF *A, const Plx_Matrix23##SUF *B, \
                                             Plx_Matrix23##SUF *AB)                             \
    {                                                                                           \
        if (!PLX_NULL3(A, B, AB)) fx::compose_affine(A->m, B->m, AB->m);                        \
    }                                                                                           \
    PLX_API Plx_Bool plx_mat23h##F##_invert_q(const Plx_Matrix23##SUF *A, Plx_Matrix23##SUF *Ainv) \
    {                                                                                           \
        if (PLX_NULL2(A, Ainv)) return null_argument(__func__);                                 \
        return report(fx::invert_affine(A->m, Ainv->m), __func__);                              \
    }                                                                                           \
    PLX_API void plx_vec3##F##_cross_s(const Plx_Vector3##SUF *a, const Plx_Vector3##SUF *b,    \
                                       Plx_Vector3##SUF *c)                                     \
    {                                                                                           \
        if (PLX_NULL3(a, b, c)) return;                                                         \
        Plx_Vector3##SUF r = {a->y * b->z - a->z * b->y, a->z * b->x - a->x * b->z,             \
                              a->x * b->y - a->y * b->x};                                       \
        *c = r;                                                                                 \
    }                                                                                           \
    }


PLX_FIXED_AFFINE(double, , )
PLX_FIXED_AFFINE(float, _f, f)
