/* Portable binary and text files of numbers, vectors and matrices.
 *
 * Binary numbers are little-endian whatever the host's byte order, in exactly 8 bytes (f64,
 * IEEE 754 double), 4 bytes (i32, ui32) or 2 bytes (i16, ui16). A short write fails with
 * code 36, a short read with code 26; a null file, or a null array with a nonzero count, fails
 * with code 32.
 *
 * Matrix blocks, binary: the caller's magic number (ui32), then
 *   Plx_Matrix:    rows, cols (ui32), rows*cols values (f64), row by row;
 *   Plx_Vector:    rows (ui32), the values (f64);
 *   Plx_SquMatrix: type, size (ui32), then only the values the type stores: symmetric and
 *                  lower triangular the lower triangle row by row, upper triangular the upper
 *                  triangle row by row, generic all n*n, diagonal the n diagonal values, scaled
 *                  identity the one value.
 * Reading checks the magic number (a mismatch is code 26) and forms the record to the stored
 * sizes as plx_mat_form and its twins do: a null record is allocated, given storage is taken
 * as unformed (free a formed record first). The storage is written only when the whole block
 * has been read.
 *
 * Text blocks, for people and for the text forms of model files: a heading line
 *   <indent><name> (matrix <rows> <cols>):     <name> (vector <rows>):
 *   <name> (<type> <size>):   with type symmetric, diagonal, scaled-identity,
 *                             lower-triangular, upper-triangular or generic,
 * then the values "%1.15g", separated by blanks, one matrix row per line (a vector on one
 * line; a diagonal matrix on one line; a scaled identity as its one value), each line indented
 * like the heading plus two blanks. Names may not contain white space. Scanning accepts any
 * white space between items, checks the name when one is given (a mismatch or any other
 * malformed item is code 26) and forms the record as reading does. Text keeps 15 significant
 * digits; the binary form keeps every bit. */
#ifndef PELLUX_FILEIO_H
#define PELLUX_FILEIO_H

#include <stdio.h>

#include "pellux/base.h"
#include "pellux/matrix.h"

#ifdef __cplusplus
extern "C" {
#endif

PLX_API Plx_Bool plx_fwrite_lendian_f64(FILE *file, const double *values, size_t count);
PLX_API Plx_Bool plx_fwrite_lendian_i32(FILE *file, const int32_t *values, size_t count);
PLX_API Plx_Bool plx_fwrite_lendian_ui32(FILE *file, const uint32_t *values, size_t count);
PLX_API Plx_Bool plx_fwrite_lendian_i16(FILE *file, const int16_t *values, size_t count);
PLX_API Plx_Bool plx_fwrite_lendian_ui16(FILE *file, const uint16_t *values, size_t count);

PLX_API Plx_Bool plx_fread_lendian_f64(FILE *file, double *values, size_t count);
PLX_API Plx_Bool plx_fread_lendian_i32(FILE *file, int32_t *values, size_t count);
PLX_API Plx_Bool plx_fread_lendian_ui32(FILE *file, uint32_t *values, size_t count);
PLX_API Plx_Bool plx_fread_lendian_i16(FILE *file, int16_t *values, size_t count);
PLX_API Plx_Bool plx_fread_lendian_ui16(FILE *file, uint16_t *values, size_t count);

PLX_API Plx_Bool plx_mat_fwrite(FILE *file, const Plx_Matrix *A, uint32_t magic);
PLX_API Plx_Bool plx_vec_fwrite(FILE *file, const Plx_Vector *x, uint32_t magic);
PLX_API Plx_Bool plx_squmat_fwrite(FILE *file, const Plx_SquMatrix *A, uint32_t magic);

PLX_API Plx_Matrix *plx_mat_fread(FILE *file, Plx_Matrix *A, uint32_t magic);
PLX_API Plx_Vector *plx_vec_fread(FILE *file, Plx_Vector *x, uint32_t magic);
PLX_API Plx_SquMatrix *plx_squmat_fread(FILE *file, Plx_SquMatrix *A, uint32_t magic);

PLX_API Plx_Bool plx_mat_fprint(FILE *file, const Plx_Matrix *A, const char *name, uint32_t indent);
PLX_API Plx_Bool plx_vec_fprint(FILE *file, const Plx_Vector *x, const char *name, uint32_t indent);
PLX_API Plx_Bool plx_squmat_fprint(FILE *file, const Plx_SquMatrix *A, const char *name,
                                   uint32_t indent);

/* name null: any name is accepted. */
PLX_API Plx_Matrix *plx_mat_fscanf(FILE *file, Plx_Matrix *A, const char *name);
PLX_API Plx_Vector *plx_vec_fscanf(FILE *file, Plx_Vector *x, const char *name);
PLX_API Plx_SquMatrix *plx_squmat_fscanf(FILE *file, Plx_SquMatrix *A, const char *name);

#ifdef __cplusplus
}
#endif

#endif
