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

/* Forms (matrix null: allocates) a rows x cols matrix with uninitialised values. */
PLX_API Plx_Matrix *plx_mat_form(Plx_Matrix *A, uint32_t rows, uint32_t cols);
PLX_API Plx_Vector *plx_vec_form(Plx_Vector *x, uint32_t rows);
PLX_API Plx_SquMatrix *plx_squmat_form(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t size);
PLX_API void plx_mat_free(Plx_Matrix *A);
PLX_API void plx_vec_free(Plx_Vector *x);
PLX_API void plx_squmat_free(Plx_SquMatrix *A);
PLX_API Plx_Bool plx_mat_fill_zero(Plx_Matrix *A);
PLX_API Plx_Bool plx_vec_fill_zero(Plx_Vector *x);
PLX_API Plx_Bool plx_squmat_fill_zero(Plx_SquMatrix *A);
/* Element access honouring the structure (setting an off-diagonal element of a symmetric
 * matrix sets both; of a diagonal or scaled identity fails with code 2). */
PLX_API double plx_squmat_get(const Plx_SquMatrix *A, uint32_t row, uint32_t col);
PLX_API Plx_Bool plx_squmat_set(Plx_SquMatrix *A, uint32_t row, uint32_t col, double value);

#ifdef __cplusplus
}
#endif

#endif
