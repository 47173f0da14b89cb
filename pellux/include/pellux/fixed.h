/* Fixed-size vectors and matrices in double and float (suffix f / _f).
 *
 * Matrices are row-major: m[row][col]. Naming: plx_<kind><size>[f]_<op>; functions that can
 * fail return Plx_Bool and register their failure (singular matrices: code 18; a matrix that
 * is not positive definite: code 32; a null argument: code 32). Results are written through
 * the last argument, which may alias an input; a failing function leaves it untouched.
 * Given a null pointer, functions without a result do nothing and those returning a number
 * return NaN.
 *
 * The operations, per size n (2, 3, 4) and precision:
 *   ident       A = I
 *   transpose   At = A^T
 *   det         determinant (accumulated in double)
 *   Fnorm       Frobenius norm sqrt(sum of squares)
 *   scale, add, sub   element-wise
 *   rmultmNN    A * B ("A right-multiplied by B")
 *   multvN      A * x;   tmultvN   A^T * x
 *   invert      inverse; a singular matrix fails with code 18: a zero row, or a pivot
 *               below 64 machine epsilons once each row is scaled to a largest magnitude
 *               of 1 (exactly singular matrices seldom give an exact zero in floating
 *               point); the float 3x3 inverse is named plx_mat33f_invert
 *   symmatNN_cholesky   lower-triangular L with L L^T = A, reading A's lower triangle;
 *               a matrix that is not positive definite fails with code 32
 *   symmatNN_eigen      eigenvalues of the symmetric A (lower triangle read) in ascending
 *               order and the matching unit eigenvectors as the columns of vectors, each
 *               with its largest-magnitude component positive; code 20 if it does not
 *               converge */
#ifndef PELLUX_FIXED_H
#define PELLUX_FIXED_H

#include "pellux/base.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct Plx_Vector2 { double x, y; } Plx_Vector2;
typedef struct Plx_Vector3 { double x, y, z; } Plx_Vector3;
typedef struct Plx_Vector4 { double x, y, z, w; } Plx_Vector4;
typedef struct Plx_Vector2_f { float x, y; } Plx_Vector2_f;
typedef struct Plx_Vector3_f { float x, y, z; } Plx_Vector3_f;
typedef struct Plx_Vector4_f { float x, y, z, w; } Plx_Vector4_f;

typedef struct Plx_Matrix22 { double m[2][2]; } Plx_Matrix22;
typedef struct Plx_Matrix23 { double m[2][3]; } Plx_Matrix23;
typedef struct Plx_Matrix33 { double m[3][3]; } Plx_Matrix33;
typedef struct Plx_Matrix44 { double m[4][4]; } Plx_Matrix44;
typedef struct Plx_Matrix22_f { float m[2][2]; } Plx_Matrix22_f;
typedef struct Plx_Matrix23_f { float m[2][3]; } Plx_Matrix23_f;
typedef struct Plx_Matrix33_f { float m[3][3]; } Plx_Matrix33_f;
typedef struct Plx_Matrix44_f { float m[4][4]; } Plx_Matrix44_f;

/* ---- 2x2, double ---- */
PLX_API void plx_mat22_ident_s(Plx_Matrix22 *A);
PLX_API void plx_mat22_transpose_s(const Plx_Matrix22 *A, Plx_Matrix22 *At);
PLX_API double plx_mat22_det_s(const Plx_Matrix22 *A);
PLX_API double plx_mat22_Fnorm_s(const Plx_Matrix22 *A);
PLX_API void plx_mat22_scale_s(const Plx_Matrix22 *A, double s, Plx_Matrix22 *sA);
PLX_API void plx_mat22_add_s(const Plx_Matrix22 *A, const Plx_Matrix22 *B, Plx_Matrix22 *AplusB);
PLX_API void plx_mat22_sub_s(const Plx_Matrix22 *A, const Plx_Matrix22 *B, Plx_Matrix22 *AminusB);
PLX_API void plx_mat22_rmultm22_s(const Plx_Matrix22 *A, const Plx_Matrix22 *B, Plx_Matrix22 *AB);
PLX_API void plx_mat22_multv2_s(const Plx_Matrix22 *A, const Plx_Vector2 *x, Plx_Vector2 *Ax);
PLX_API void plx_mat22_tmultv2_s(const Plx_Matrix22 *A, const Plx_Vector2 *x, Plx_Vector2 *Atx);
PLX_API Plx_Bool plx_mat22_invert_s(const Plx_Matrix22 *A, Plx_Matrix22 *Ainv);
PLX_API Plx_Bool plx_symmat22_cholesky(const Plx_Matrix22 *A, Plx_Matrix22 *L);
PLX_API Plx_Bool plx_symmat22_eigen(const Plx_Matrix22 *A, Plx_Vector2 *values, Plx_Matrix22 *vectors);

/* ---- 2x2, float ---- */
PLX_API void plx_mat22f_ident_s(Plx_Matrix22_f *A);
PLX_API void plx_mat22f_transpose_s(const Plx_Matrix22_f *A, Plx_Matrix22_f *At);
PLX_API float plx_mat22f_det_s(const Plx_Matrix22_f *A);
PLX_API float plx_mat22f_Fnorm_s(const Plx_Matrix22_f *A);
PLX_API void plx_mat22f_scale_s(const Plx_Matrix22_f *A, float s, Plx_Matrix22_f *sA);
PLX_API void plx_mat22f_add_s(const Plx_Matrix22_f *A, const Plx_Matrix22_f *B, Plx_Matrix22_f *AplusB);
PLX_API void plx_mat22f_sub_s(const Plx_Matrix22_f *A, const Plx_Matrix22_f *B, Plx_Matrix22_f *AminusB);
PLX_API void plx_mat22f_rmultm22_s(const Plx_Matrix22_f *A, const Plx_Matrix22_f *B, Plx_Matrix22_f *AB);
PLX_API void plx_mat22f_multv2_s(const Plx_Matrix22_f *A, const Plx_Vector2_f *x, Plx_Vector2_f *Ax);
PLX_API void plx_mat22f_tmultv2_s(const Plx_Matrix22_f *A, const Plx_Vector2_f *x, Plx_Vector2_f *Atx);
PLX_API Plx_Bool plx_mat22f_invert_s(const Plx_Matrix22_f *A, Plx_Matrix22_f *Ainv);
PLX_API Plx_Bool plx_symmat22f_cholesky(const Plx_Matrix22_f *A, Plx_Matrix22_f *L);
PLX_API Plx_Bool plx_symmat22f_eigen(const Plx_Matrix22_f *A, Plx_Vector2_f *values, Plx_Matrix22_f *vectors);

PLX_API void plx_mat22f_from_mat22(const Plx_Matrix22 *A, Plx_Matrix22_f *Af);
PLX_API void plx_mat22_from_mat22f(const Plx_Matrix22_f *Af, Plx_Matrix22 *A);

/* ---- 3x3, double ---- */
PLX_API void plx_mat33_ident_s(Plx_Matrix33 *A);
PLX_API void plx_mat33_transpose_s(const Plx_Matrix33 *A, Plx_Matrix33 *At);
PLX_API double plx_mat33_det_s(const Plx_Matrix33 *A);
PLX_API double plx_mat33_Fnorm_s(const Plx_Matrix33 *A);
PLX_API void plx_mat33_scale_s(const Plx_Matrix33 *A, double s, Plx_Matrix33 *sA);
PLX_API void plx_mat33_add_s(const Plx_Matrix33 *A, const Plx_Matrix33 *B, Plx_Matrix33 *AplusB);
PLX_API void plx_mat33_sub_s(const Plx_Matrix33 *A, const Plx_Matrix33 *B, Plx_Matrix33 *AminusB);
PLX_API void plx_mat33_rmultm33_s(const Plx_Matrix33 *A, const Plx_Matrix33 *B, Plx_Matrix33 *AB);
PLX_API void plx_mat33_multv3_s(const Plx_Matrix33 *A, const Plx_Vector3 *x, Plx_Vector3 *Ax);
PLX_API void plx_mat33_tmultv3_s(const Plx_Matrix33 *A, const Plx_Vector3 *x, Plx_Vector3 *Atx);
PLX_API Plx_Bool plx_mat33_invert_s(const Plx_Matrix33 *A, Plx_Matrix33 *Ainv);
PLX_API Plx_Bool plx_symmat33_cholesky(const Plx_Matrix33 *A, Plx_Matrix33 *L);
PLX_API Plx_Bool plx_symmat33_eigen(const Plx_Matrix33 *A, Plx_Vector3 *values, Plx_Matrix33 *vectors);

/* ---- 3x3, float ---- */
PLX_API void plx_mat33f_ident_s(Plx_Matrix33_f *A);
PLX_API void plx_mat33f_transpose_s(const Plx_Matrix33_f *A, Plx_Matrix33_f *At);
PLX_API float plx_mat33f_det_s(const Plx_Matrix33_f *A);
PLX_API float plx_mat33f_Fnorm_s(const Plx_Matrix33_f *A);
PLX_API void plx_mat33f_scale_s(const Plx_Matrix33_f *A, float s, Plx_Matrix33_f *sA);
PLX_API void plx_mat33f_add_s(const Plx_Matrix33_f *A, const Plx_Matrix33_f *B, Plx_Matrix33_f *AplusB);
PLX_API void plx_mat33f_sub_s(const Plx_Matrix33_f *A, const Plx_Matrix33_f *B, Plx_Matrix33_f *AminusB);
PLX_API void plx_mat33f_rmultm33_s(const Plx_Matrix33_f *A, const Plx_Matrix33_f *B, Plx_Matrix33_f *AB);
PLX_API void plx_mat33f_multv3_s(const Plx_Matrix33_f *A, const Plx_Vector3_f *x, Plx_Vector3_f *Ax);
PLX_API void plx_mat33f_tmultv3_s(const Plx_Matrix33_f *A, const Plx_Vector3_f *x, Plx_Vector3_f *Atx);
PLX_API Plx_Bool plx_mat33f_invert(const Plx_Matrix33_f *A, Plx_Matrix33_f *Ainv);
PLX_API Plx_Bool plx_symmat33f_cholesky(const Plx_Matrix33_f *A, Plx_Matrix33_f *L);
PLX_API Plx_Bool plx_symmat33f_eigen(const Plx_Matrix33_f *A, Plx_Vector3_f *values, Plx_Matrix33_f *vectors);

PLX_API void plx_mat33f_from_mat33(const Plx_Matrix33 *A, Plx_Matrix33_f *Af);
PLX_API void plx_mat33_from_mat33f(const Plx_Matrix33_f *Af, Plx_Matrix33 *A);

/* ---- 4x4, double ---- */
PLX_API void plx_mat44_ident_s(Plx_Matrix44 *A);
PLX_API void plx_mat44_transpose_s(const Plx_Matrix44 *A, Plx_Matrix44 *At);
PLX_API double plx_mat44_det_s(const Plx_Matrix44 *A);
PLX_API double plx_mat44_Fnorm_s(const Plx_Matrix44 *A);
PLX_API void plx_mat44_scale_s(const Plx_Matrix44 *A, double s, Plx_Matrix44 *sA);
PLX_API void plx_mat44_add_s(const Plx_Matrix44 *A, const Plx_Matrix44 *B, Plx_Matrix44 *AplusB);
PLX_API void plx_mat44_sub_s(const Plx_Matrix44 *A, const Plx_Matrix44 *B, Plx_Matrix44 *AminusB);
PLX_API void plx_mat44_rmultm44_s(const Plx_Matrix44 *A, const Plx_Matrix44 *B, Plx_Matrix44 *AB);
PLX_API void plx_mat44_multv4_s(const Plx_Matrix44 *A, const Plx_Vector4 *x, Plx_Vector4 *Ax);
PLX_API void plx_mat44_tmultv4_s(const Plx_Matrix44 *A, const Plx_Vector4 *x, Plx_Vector4 *Atx);
PLX_API Plx_Bool plx_mat44_invert_s(const Plx_Matrix44 *A, Plx_Matrix44 *Ainv);
PLX_API Plx_Bool plx_symmat44_cholesky(const Plx_Matrix44 *A, Plx_Matrix44 *L);
PLX_API Plx_Bool plx_symmat44_eigen(const Plx_Matrix44 *A, Plx_Vector4 *values, Plx_Matrix44 *vectors);

/* ---- 4x4, float ---- */
PLX_API void plx_mat44f_ident_s(Plx_Matrix44_f *A);
PLX_API void plx_mat44f_transpose_s(const Plx_Matrix44_f *A, Plx_Matrix44_f *At);
PLX_API float plx_mat44f_det_s(const Plx_Matrix44_f *A);
PLX_API float plx_mat44f_Fnorm_s(const Plx_Matrix44_f *A);
PLX_API void plx_mat44f_scale_s(const Plx_Matrix44_f *A, float s, Plx_Matrix44_f *sA);
PLX_API void plx_mat44f_add_s(const Plx_Matrix44_f *A, const Plx_Matrix44_f *B, Plx_Matrix44_f *AplusB);
PLX_API void plx_mat44f_sub_s(const Plx_Matrix44_f *A, const Plx_Matrix44_f *B, Plx_Matrix44_f *AminusB);
PLX_API void plx_mat44f_rmultm44_s(const Plx_Matrix44_f *A, const Plx_Matrix44_f *B, Plx_Matrix44_f *AB);
PLX_API void plx_mat44f_multv4_s(const Plx_Matrix44_f *A, const Plx_Vector4_f *x, Plx_Vector4_f *Ax);
PLX_API void plx_mat44f_tmultv4_s(const Plx_Matrix44_f *A, const Plx_Vector4_f *x, Plx_Vector4_f *Atx);
PLX_API Plx_Bool plx_mat44f_invert_s(const Plx_Matrix44_f *A, Plx_Matrix44_f *Ainv);
PLX_API Plx_Bool plx_symmat44f_cholesky(const Plx_Matrix44_f *A, Plx_Matrix44_f *L);
PLX_API Plx_Bool plx_symmat44f_eigen(const Plx_Matrix44_f *A, Plx_Vector4_f *values, Plx_Matrix44_f *vectors);

PLX_API void plx_mat44f_from_mat44(const Plx_Matrix44 *A, Plx_Matrix44_f *Af);
PLX_API void plx_mat44_from_mat44f(const Plx_Matrix44_f *Af, Plx_Matrix44 *A);

/* ---- 2x3: affine maps [A | t] and plain 2x3 products ---- */
/* A * x for a 3-vector x. */
PLX_API void plx_mat23_multv3_s(const Plx_Matrix23 *A, const Plx_Vector3 *x, Plx_Vector2 *Ax);
/* The affine map applied to a point: A (x, y, 1)^T. */
PLX_API void plx_mat23h_multv2_s(const Plx_Matrix23 *A, const Plx_Vector2 *x, Plx_Vector2 *Ax);
/* Composition of affine maps: the map x -> A (B x). */
PLX_API void plx_mat23h_rmultm23h_s(const Plx_Matrix23 *A, const Plx_Matrix23 *B, Plx_Matrix23 *AB);
/* A * x for a 3-vector x. */
PLX_API void plx_mat23f_multv3_s(const Plx_Matrix23_f *A, const Plx_Vector3_f *x, Plx_Vector2_f *Ax);
/* The affine map applied to a point: A (x, y, 1)^T. */
PLX_API void plx_mat23hf_multv2_s(const Plx_Matrix23_f *A, const Plx_Vector2_f *x, Plx_Vector2_f *Ax);
/* Composition of affine maps: the map x -> A (B x). */
PLX_API void plx_mat23hf_rmultm23h_s(const Plx_Matrix23_f *A, const Plx_Matrix23_f *B, Plx_Matrix23_f *AB);
/* Inverse of the affine map [A | t] of a 2x3 matrix taken as the 3x3 matrix with last row
 * (0, 0, 1); a singular 2x2 part (by the relative test of invert) fails with code 18. */
PLX_API Plx_Bool plx_mat23hf_invert_q(const Plx_Matrix23_f *A, Plx_Matrix23_f *Ainv);
PLX_API Plx_Bool plx_mat23h_invert_q(const Plx_Matrix23 *A, Plx_Matrix23 *Ainv);
PLX_API void plx_mat23f_from_mat23(const Plx_Matrix23 *A, Plx_Matrix23_f *Af);
PLX_API void plx_mat23_from_mat23f(const Plx_Matrix23_f *Af, Plx_Matrix23 *A);

/* ---- vectors ---- */
PLX_API void plx_vec2_add_s(const Plx_Vector2 *a, const Plx_Vector2 *b, Plx_Vector2 *aplusb);
PLX_API void plx_vec2_sub_s(const Plx_Vector2 *a, const Plx_Vector2 *b, Plx_Vector2 *aminusb);
PLX_API void plx_vec2_scale_s(const Plx_Vector2 *a, double s, Plx_Vector2 *sa);
PLX_API double plx_vec2_dot_s(const Plx_Vector2 *a, const Plx_Vector2 *b);
/* Euclidean length. */
PLX_API double plx_vec2_norm_s(const Plx_Vector2 *a);
PLX_API void plx_vec2f_add_s(const Plx_Vector2_f *a, const Plx_Vector2_f *b, Plx_Vector2_f *aplusb);
PLX_API void plx_vec2f_sub_s(const Plx_Vector2_f *a, const Plx_Vector2_f *b, Plx_Vector2_f *aminusb);
PLX_API void plx_vec2f_scale_s(const Plx_Vector2_f *a, float s, Plx_Vector2_f *sa);
PLX_API float plx_vec2f_dot_s(const Plx_Vector2_f *a, const Plx_Vector2_f *b);
/* Euclidean length. */
PLX_API float plx_vec2f_norm_s(const Plx_Vector2_f *a);
PLX_API void plx_vec3_add_s(const Plx_Vector3 *a, const Plx_Vector3 *b, Plx_Vector3 *aplusb);
PLX_API void plx_vec3_sub_s(const Plx_Vector3 *a, const Plx_Vector3 *b, Plx_Vector3 *aminusb);
PLX_API void plx_vec3_scale_s(const Plx_Vector3 *a, double s, Plx_Vector3 *sa);
PLX_API double plx_vec3_dot_s(const Plx_Vector3 *a, const Plx_Vector3 *b);
/* Euclidean length. */
PLX_API double plx_vec3_norm_s(const Plx_Vector3 *a);
PLX_API void plx_vec3_cross_s(const Plx_Vector3 *a, const Plx_Vector3 *b, Plx_Vector3 *axb);
PLX_API void plx_vec3f_add_s(const Plx_Vector3_f *a, const Plx_Vector3_f *b, Plx_Vector3_f *aplusb);
PLX_API void plx_vec3f_sub_s(const Plx_Vector3_f *a, const Plx_Vector3_f *b, Plx_Vector3_f *aminusb);
PLX_API void plx_vec3f_scale_s(const Plx_Vector3_f *a, float s, Plx_Vector3_f *sa);
PLX_API float plx_vec3f_dot_s(const Plx_Vector3_f *a, const Plx_Vector3_f *b);
/* Euclidean length. */
PLX_API float plx_vec3f_norm_s(const Plx_Vector3_f *a);
PLX_API void plx_vec3f_cross_s(const Plx_Vector3_f *a, const Plx_Vector3_f *b, Plx_Vector3_f *axb);
PLX_API void plx_vec4_add_s(const Plx_Vector4 *a, const Plx_Vector4 *b, Plx_Vector4 *aplusb);
PLX_API void plx_vec4_sub_s(const Plx_Vector4 *a, const Plx_Vector4 *b, Plx_Vector4 *aminusb);
PLX_API void plx_vec4_scale_s(const Plx_Vector4 *a, double s, Plx_Vector4 *sa);
PLX_API double plx_vec4_dot_s(const Plx_Vector4 *a, const Plx_Vector4 *b);
/* Euclidean length. */
PLX_API double plx_vec4_norm_s(const Plx_Vector4 *a);
PLX_API void plx_vec4f_add_s(const Plx_Vector4_f *a, const Plx_Vector4_f *b, Plx_Vector4_f *aplusb);
PLX_API void plx_vec4f_sub_s(const Plx_Vector4_f *a, const Plx_Vector4_f *b, Plx_Vector4_f *aminusb);
PLX_API void plx_vec4f_scale_s(const Plx_Vector4_f *a, float s, Plx_Vector4_f *sa);
PLX_API float plx_vec4f_dot_s(const Plx_Vector4_f *a, const Plx_Vector4_f *b);
/* Euclidean length. */
PLX_API float plx_vec4f_norm_s(const Plx_Vector4_f *a);

#ifdef __cplusplus
}
#endif

#endif
