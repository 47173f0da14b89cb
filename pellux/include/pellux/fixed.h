/* Fixed-size vectors and matrices in double and float (suffix f / _f).
 *
 * Matrices are row-major: m[row][col]. Naming: plx_<kind><size>[f]_<op>; functions that can
 * fail return Plx_Bool and register their failure (singular matrices: code 18; a matrix that
 * is not positive definite: code 32). Results are written through the last argument, which
 * may alias an input. */
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

/* ---- 3x3, the homography workhorse ---- */
PLX_API void plx_mat33_ident_s(Plx_Matrix33 *A);
PLX_API void plx_mat33_transpose_s(const Plx_Matrix33 *A, Plx_Matrix33 *At);
PLX_API double plx_mat33_det_s(const Plx_Matrix33 *A);
/* Frobenius norm. */
PLX_API double plx_mat33_Fnorm_s(const Plx_Matrix33 *A);
PLX_API void plx_mat33_scale_s(const Plx_Matrix33 *A, double s, Plx_Matrix33 *sA);
/* A * B ("right-multiplied by B"). */
PLX_API void plx_mat33_rmultm33_s(const Plx_Matrix33 *A, const Plx_Matrix33 *B, Plx_Matrix33 *AB);
PLX_API void plx_mat33_multv3_s(const Plx_Matrix33 *A, const Plx_Vector3 *x, Plx_Vector3 *Ax);
/* Inverse; a zero or non-finite determinant fails with code 18. */
PLX_API Plx_Bool plx_mat33_invert_s(const Plx_Matrix33 *A, Plx_Matrix33 *Ainv);
PLX_API Plx_Bool plx_mat33f_invert(const Plx_Matrix33_f *A, Plx_Matrix33_f *Ainv);
PLX_API void plx_mat33f_multv3_s(const Plx_Matrix33_f *A, const Plx_Vector3_f *x, Plx_Vector3_f *Ax);
PLX_API void plx_mat33f_from_mat33(const Plx_Matrix33 *A, Plx_Matrix33_f *Af);
PLX_API void plx_mat33_from_mat33f(const Plx_Matrix33_f *Af, Plx_Matrix33 *A);
/* Inverse of the affine map [A | t] of a 2x3 matrix taken as the 3x3 matrix with last row
 * (0, 0, 1); a singular 2x2 part fails with code 18. */
PLX_API Plx_Bool plx_mat23hf_invert_q(const Plx_Matrix23_f *A, Plx_Matrix23_f *Ainv);
PLX_API Plx_Bool plx_mat23h_invert_q(const Plx_Matrix23 *A, Plx_Matrix23 *Ainv);

#ifdef __cplusplus
}
#endif

#endif
