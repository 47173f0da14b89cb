/* General matrices and vectors of doubles, and square matrices with structure.
 *
 * Plx_Matrix is row-major and contiguous: element (r, c) is data[r * cols + c]. Records may
 * live in caller storage (form) or on the heap (new: owned flag set); the data block is
 * owned unless the record was formed on caller-supplied data. Resizing within the allocated
 * capacity never reallocates.
 *
 * Plx_SquMatrix of size n stores: symmetric, lower and upper triangular matrices as full
 * n x n row-major arrays (a symmetric matrix keeps both triangles equal; a triangular one
 * keeps zeros in the other triangle); diagonal matrices as n values; scaled identities as one
 * value. */
#ifndef PELLUX_MATRIX_H
#define PELLUX_MATRIX_H

#include "pellux/base.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct Plx_Matrix {
    uint32_t rows, cols;
    double *data;
    size_t capacity;       /* doubles allocated in data */
    uint32_t data_owned;   /* 1: data is released with the matrix */
    uint32_t owned;        /* 1: the record came from the heap */
} Plx_Matrix;

typedef struct Plx_Vector {
    uint32_t rows;
    double *data;
    size_t capacity;
    uint32_t data_owned;
    uint32_t owned;
} Plx_Vector;

typedef enum Plx_SquMatrixType {
    PLX_SQUMAT_NONE = 0,
    PLX_SQUMAT_SYMMETRIC = 1,
    PLX_SQUMAT_DIAGONAL = 2,
    PLX_SQUMAT_SCALED_IDENTITY = 3,
    PLX_SQUMAT_LOWER_TRIANGULAR = 4,
    PLX_SQUMAT_UPPER_TRIANGULAR = 5,
    PLX_SQUMAT_GENERIC = 6
} Plx_SquMatrixType;

typedef struct Plx_SquMatrix {
    Plx_SquMatrixType type;
    uint32_t size;
    double *data;
    size_t capacity;
    uint32_t data_owned;
    uint32_t owned;
} Plx_SquMatrix;

/* Conventions of the operations below.
 * - Records: form (record null: allocates it) leaves values uninitialised; form_data makes a
 *   record over caller data (never freed by the library; resizing beyond its capacity fails
 *   with code 7); new is form with a null record; free releases what the record owns.
 * - Sizes that do not fit together fail with code 7, an operation the structure type of a
 *   square matrix does not support (or a result its type cannot hold) with code 2, an
 *   unknown structure type with code 12, a null argument with code 32. A failing function
 *   leaves its outputs as they were.
 * - Outputs may alias inputs unless a function says otherwise.
 * - Results of functions that compute numbers come back through their last argument. */

/* ---- general matrices ---- */

/* Forms (matrix null: allocates) a rows x cols matrix with uninitialised values. */
PLX_API Plx_Matrix *plx_mat_form(Plx_Matrix *A, uint32_t rows, uint32_t cols);
PLX_API Plx_Matrix *plx_mat_new(uint32_t rows, uint32_t cols);
/* A rows x cols matrix over data (rows * cols doubles at least), which the caller keeps. */
PLX_API Plx_Matrix *plx_mat_form_data(Plx_Matrix *A, uint32_t rows, uint32_t cols, double *data);
/* New size; the block is reused when it holds rows * cols values, else (owned data only)
 * replaced. Values are kept as they lie in memory, not re-laid out. */
PLX_API Plx_Bool plx_mat_resize(Plx_Matrix *A, uint32_t rows, uint32_t cols);
PLX_API void plx_mat_free(Plx_Matrix *A);
PLX_API Plx_Bool plx_mat_fill_zero(Plx_Matrix *A);
/* Fills from rows * cols values in row-major order (doubles; the _va form takes them as
 * arguments). */
PLX_API Plx_Bool plx_mat_fill(Plx_Matrix *A, const double *values);
PLX_API Plx_Bool plx_mat_fill_va(Plx_Matrix *A, ...);
/* Reads the values in row-major order into an array, or (_va) through rows * cols
 * double pointers. */
PLX_API Plx_Bool plx_mat_read(const Plx_Matrix *A, double *values);
PLX_API Plx_Bool plx_mat_read_va(const Plx_Matrix *A, ...);
/* B = A (same size). */
PLX_API Plx_Bool plx_mat_copy(const Plx_Matrix *A, Plx_Matrix *B);
PLX_API Plx_Bool plx_mat_scale(const Plx_Matrix *A, double s, Plx_Matrix *sA);
PLX_API Plx_Bool plx_mat_add(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *AplusB);
PLX_API Plx_Bool plx_mat_sub(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *AminusB);
/* C = A B, C = A^T B, C = A B^T. */
PLX_API Plx_Bool plx_mat_mult(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C);
PLX_API Plx_Bool plx_mat_tmult(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C);
PLX_API Plx_Bool plx_mat_multt(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C);
/* C = alpha op(A) op(B) + beta C, op transposing when its flag is 1 (beta 0: C's old values
 * are not read). */
PLX_API Plx_Bool plx_mat_gemm(double alpha, const Plx_Matrix *A, Plx_Bool transpose_A,
                              const Plx_Matrix *B, Plx_Bool transpose_B, double beta, Plx_Matrix *C);
/* y = A x, y = A^T x. */
PLX_API Plx_Bool plx_mat_multv(const Plx_Matrix *A, const Plx_Vector *x, Plx_Vector *y);
PLX_API Plx_Bool plx_mat_tmultv(const Plx_Matrix *A, const Plx_Vector *x, Plx_Vector *y);
/* y = alpha op(A) x + beta y. */
PLX_API Plx_Bool plx_mat_gemv(double alpha, const Plx_Matrix *A, Plx_Bool transpose_A,
                              const Plx_Vector *x, double beta, Plx_Vector *y);
/* At = A^T (At cols x rows). */
PLX_API Plx_Bool plx_mat_transpose(const Plx_Matrix *A, Plx_Matrix *At);
/* Copies B into A with B's top-left element at (row, col); B must fit inside A. */
PLX_API Plx_Bool plx_mat_insert(Plx_Matrix *A, uint32_t row, uint32_t col, const Plx_Matrix *B);
/* B = the block of A of B's size whose top-left element is (row, col). */
PLX_API Plx_Bool plx_mat_extract(const Plx_Matrix *A, uint32_t row, uint32_t col, Plx_Matrix *B);

/* ---- vectors ---- */

PLX_API Plx_Vector *plx_vec_form(Plx_Vector *x, uint32_t rows);
PLX_API Plx_Vector *plx_vec_new(uint32_t rows);
PLX_API Plx_Vector *plx_vec_form_data(Plx_Vector *x, uint32_t rows, double *data);
PLX_API Plx_Bool plx_vec_resize(Plx_Vector *x, uint32_t rows);
PLX_API void plx_vec_free(Plx_Vector *x);
PLX_API Plx_Bool plx_vec_fill_zero(Plx_Vector *x);
PLX_API Plx_Bool plx_vec_fill(Plx_Vector *x, const double *values);
PLX_API Plx_Bool plx_vec_fill_va(Plx_Vector *x, ...);
PLX_API Plx_Bool plx_vec_read(const Plx_Vector *x, double *values);
PLX_API Plx_Bool plx_vec_read_va(const Plx_Vector *x, ...);
PLX_API Plx_Bool plx_vec_copy(const Plx_Vector *x, Plx_Vector *y);
PLX_API Plx_Bool plx_vec_scale(const Plx_Vector *x, double s, Plx_Vector *sx);
PLX_API Plx_Bool plx_vec_add(const Plx_Vector *x, const Plx_Vector *y, Plx_Vector *xplusy);
PLX_API Plx_Bool plx_vec_sub(const Plx_Vector *x, const Plx_Vector *y, Plx_Vector *xminusy);
PLX_API Plx_Bool plx_vec_dot(const Plx_Vector *x, const Plx_Vector *y, double *dot);
/* Euclidean length. */
PLX_API Plx_Bool plx_vec_norm(const Plx_Vector *x, double *norm);
/* Copies y into x starting at element pos; y must fit. */
PLX_API Plx_Bool plx_vec_insert(Plx_Vector *x, uint32_t pos, const Plx_Vector *y);
/* y = the elements of x from pos, y's size of them. */
PLX_API Plx_Bool plx_vec_extract(const Plx_Vector *x, uint32_t pos, Plx_Vector *y);

/* ---- square matrices with structure ----
 * Element-wise results (copy, scale, add, sub, transpose) keep the output's type, which must
 * be able to hold the result (a generic matrix holds anything; symmetric and triangular ones
 * hold diagonal ones; a diagonal one holds a scaled identity). Factorisations and inverses
 * give the output the type of their result and need only its size to match and its block
 * to be large enough. */

PLX_API Plx_SquMatrix *plx_squmat_form(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t size);
PLX_API Plx_SquMatrix *plx_squmat_new(Plx_SquMatrixType type, uint32_t size);
/* Over caller data holding the values the type stores (see above). */
PLX_API Plx_SquMatrix *plx_squmat_form_data(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t size,
                                            double *data);
/* New type and size, reusing the block when large enough; values are left as they lie. */
PLX_API Plx_Bool plx_squmat_resize(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t size);
PLX_API void plx_squmat_free(Plx_SquMatrix *A);
PLX_API Plx_Bool plx_squmat_fill_zero(Plx_SquMatrix *A);
/* A = s I (any type). */
PLX_API Plx_Bool plx_squmat_fill_scaled_identity(Plx_SquMatrix *A, double s);
/* Fills from the values the type stores: n x n row-major for symmetric (its lower triangle is
 * read and mirrored), triangular (the other triangle is ignored and kept zero) and generic
 * types, n diagonal values, or one value for a scaled identity. */
PLX_API Plx_Bool plx_squmat_fill(Plx_SquMatrix *A, const double *values);
PLX_API Plx_Bool plx_squmat_fill_va(Plx_SquMatrix *A, ...);
/* Reads the values the type stores (n x n for the full types). */
PLX_API Plx_Bool plx_squmat_read(const Plx_SquMatrix *A, double *values);
/* Element access honouring the structure (setting an off-diagonal element of a symmetric
 * matrix sets both; of a diagonal or scaled identity, or outside a triangle, fails with
 * code 2; a diagonal element of a scaled identity sets its scale). get returns NaN for an
 * element outside the matrix. */
PLX_API double plx_squmat_get(const Plx_SquMatrix *A, uint32_t row, uint32_t col);
PLX_API Plx_Bool plx_squmat_set(Plx_SquMatrix *A, uint32_t row, uint32_t col, double value);
/* Dense copies to and from a general n x n matrix; from_mat reads only what the type stores
 * (a symmetric matrix its lower triangle, a scaled identity element (0, 0)). */
PLX_API Plx_Bool plx_squmat_to_mat(const Plx_SquMatrix *A, Plx_Matrix *M);
PLX_API Plx_Bool plx_squmat_from_mat(const Plx_Matrix *M, Plx_SquMatrix *A);
PLX_API Plx_Bool plx_squmat_copy(const Plx_SquMatrix *A, Plx_SquMatrix *B);
PLX_API Plx_Bool plx_squmat_scale(const Plx_SquMatrix *A, double s, Plx_SquMatrix *sA);
PLX_API Plx_Bool plx_squmat_add(const Plx_SquMatrix *A, const Plx_SquMatrix *B, Plx_SquMatrix *C);
PLX_API Plx_Bool plx_squmat_sub(const Plx_SquMatrix *A, const Plx_SquMatrix *B, Plx_SquMatrix *C);
PLX_API Plx_Bool plx_squmat_transpose(const Plx_SquMatrix *A, Plx_SquMatrix *At);
/* y = A x, y = A^T x. */
PLX_API Plx_Bool plx_squmat_multv(const Plx_SquMatrix *A, const Plx_Vector *x, Plx_Vector *y);
PLX_API Plx_Bool plx_squmat_tmultv(const Plx_SquMatrix *A, const Plx_Vector *x, Plx_Vector *y);
/* C = A B, C = A^T B for a general B (n x m) and C (n x m). */
PLX_API Plx_Bool plx_squmat_multm(const Plx_SquMatrix *A, const Plx_Matrix *B, Plx_Matrix *C);
PLX_API Plx_Bool plx_squmat_tmultm(const Plx_SquMatrix *A, const Plx_Matrix *B, Plx_Matrix *C);
/* x^T A x. */
PLX_API Plx_Bool plx_squmat_quadform(const Plx_SquMatrix *A, const Plx_Vector *x, double *value);
/* Symmetric updates of a symmetric or generic A (n x n): A += alpha B^T B for B (m x n);
 * A += alpha x x^T; A += alpha J^T N J for J (m x n) and a symmetric, diagonal or scaled
 * identity N (m x m). */
PLX_API Plx_Bool plx_squmat_add_rank(Plx_SquMatrix *A, double alpha, const Plx_Matrix *B);
PLX_API Plx_Bool plx_squmat_add_outer(Plx_SquMatrix *A, double alpha, const Plx_Vector *x);
PLX_API Plx_Bool plx_squmat_add_sandwich(Plx_SquMatrix *A, double alpha, const Plx_Matrix *J,
                                         const Plx_SquMatrix *N);
/* Cholesky factor L (L L^T = A) of a symmetric, diagonal or scaled identity A: L is lower
 * triangular (diagonal or scaled identity for those types). L may be A (factorised in place).
 * A matrix that is not positive definite fails with code 32. */
PLX_API Plx_Bool plx_squmat_cholesky(const Plx_SquMatrix *A, Plx_SquMatrix *L);
/* x = op(T)^-1 b for a triangular, diagonal or scaled identity T, op transposing when
 * transpose is 1; a zero diagonal element fails with code 18. */
PLX_API Plx_Bool plx_squmat_trisolve_v(const Plx_SquMatrix *T, Plx_Bool transpose, const Plx_Vector *b,
                                       Plx_Vector *x);
/* X = op(T)^-1 B for a general B (n x m). */
PLX_API Plx_Bool plx_squmat_trisolve_m(const Plx_SquMatrix *T, Plx_Bool transpose, const Plx_Matrix *B,
                                       Plx_Matrix *X);
/* Ainv = (L L^T)^-1, symmetric, from a Cholesky factor L (lower triangular, diagonal or scaled
 * identity). */
PLX_API Plx_Bool plx_squmat_cholesky_invert(const Plx_SquMatrix *L, Plx_SquMatrix *Ainv);
/* Inverse of the same structure: symmetric through Cholesky (code 32 when not positive
 * definite), others by elimination (code 18 when singular). */
PLX_API Plx_Bool plx_squmat_invert(const Plx_SquMatrix *A, Plx_SquMatrix *Ainv);
/* Eigen-decomposition of a symmetric, diagonal or scaled identity A: eigenvalues ascending
 * into values (n), matching unit eigenvectors as the columns of vectors (n x n), each with
 * its largest-magnitude component positive. Code 20 if it does not converge. */
PLX_API Plx_Bool plx_squmat_eigen(const Plx_SquMatrix *A, Plx_Vector *values, Plx_Matrix *vectors);

#ifdef __cplusplus
}
#endif

#endif
