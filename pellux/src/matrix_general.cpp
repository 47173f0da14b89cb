// General row-major matrices and vectors of doubles.
#include <Eigen/Core>
#include <cmath>
#include <cstdarg>
#include <cstdlib>
#include <cstring>

#include "matrix_internal.hpp"
#include "pellux/detail/util.hpp"
#include "pellux/matrix.h"

namespace {

using plx::null_argument;
using RMat = Eigen::Matrix<double, Eigen::Dynamic, Eigen::Dynamic, Eigen::RowMajor>;
using MapM = Eigen::Map<RMat>;
using MapCM = Eigen::Map<const RMat>;
using MapV = Eigen::Map<Eigen::VectorXd>;
using MapCV = Eigen::Map<const Eigen::VectorXd>;

inline std::size_t count(const Plx_Matrix *A) { return std::size_t(A->rows) * A->cols; }
inline MapCM map(const Plx_Matrix *A) { return MapCM(A->data, A->rows, A->cols); }
inline MapM map(Plx_Matrix *A) { return MapM(A->data, A->rows, A->cols); }
inline MapCV map(const Plx_Vector *x) { return MapCV(x->data, x->rows); }
inline MapV map(Plx_Vector *x) { return MapV(x->data, x->rows); }

bool same_size(const Plx_Matrix *A, const Plx_Matrix *B, const char *function)
{
    if (A->rows == B->rows && A->cols == B->cols) return true;
    return PLX_FAIL(function, PLX_ERROR_INCOMPATIBLE, "matrix sizes differ", B->rows);
}

bool same_size(const Plx_Vector *x, const Plx_Vector *y, const char *function)
{
    if (x->rows == y->rows) return true;
    return PLX_FAIL(function, PLX_ERROR_INCOMPATIBLE, "vector sizes differ", y->rows);
}

// Records with a null data block only count as valid when they hold no values.
bool usable(const Plx_Matrix *A) { return A != nullptr && (A->data != nullptr || count(A) == 0); }
bool usable(const Plx_Vector *x) { return x != nullptr && (x->data != nullptr || x->rows == 0); }

}  // namespace

extern "C" {

// ---- general matrices ----

PLX_API Plx_Matrix *plx_mat_form(Plx_Matrix *A, uint32_t rows, uint32_t cols)
{
    return plx::form_record(A, Plx_Matrix{rows, cols, nullptr, 0, 0, 0}, std::size_t(rows) * cols, __func__);
}

PLX_API Plx_Matrix *plx_mat_new(uint32_t rows, uint32_t cols)
{
    Plx_Matrix *A = plx_mat_form(nullptr, rows, cols);
    if (A == nullptr) PLX_ERR_PASS();
    return A;
}

PLX_API Plx_Matrix *plx_mat_form_data(Plx_Matrix *A, uint32_t rows, uint32_t cols, double *data)
{
    if (data == nullptr && std::size_t(rows) * cols > 0) {
        null_argument(__func__);
        return nullptr;
    }
    return plx::form_record(A, Plx_Matrix{rows, cols, data, std::size_t(rows) * cols, 0, 0}, 0, __func__);
}

PLX_API Plx_Bool plx_mat_resize(Plx_Matrix *A, uint32_t rows, uint32_t cols)
{
    if (A == nullptr) return null_argument(__func__);
    if (!plx::ensure_block(A->data, A->capacity, A->data_owned, std::size_t(rows) * cols, __func__))
        return PLX_FALSE;
    A->rows = rows;
    A->cols = cols;
    return PLX_TRUE;
}

PLX_API void plx_mat_free(Plx_Matrix *A) { plx::free_record(A); }

PLX_API Plx_Bool plx_mat_fill_zero(Plx_Matrix *A)
{
    if (!usable(A)) return null_argument(__func__);
    if (count(A) > 0) std::memset(A->data, 0, count(A) * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_fill(Plx_Matrix *A, const double *values)
{
    if (!usable(A) || (values == nullptr && count(A) > 0)) return null_argument(__func__);
    if (count(A) > 0) std::memmove(A->data, values, count(A) * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_fill_va(Plx_Matrix *A, ...)
{
    if (!usable(A)) return null_argument(__func__);
    va_list ap;
    va_start(ap, A);
    for (std::size_t i = 0, n = count(A); i < n; ++i) A->data[i] = va_arg(ap, double);
    va_end(ap);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_read(const Plx_Matrix *A, double *values)
{
    if (!usable(A) || (values == nullptr && count(A) > 0)) return null_argument(__func__);
    if (count(A) > 0) std::memmove(values, A->data, count(A) * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_read_va(const Plx_Matrix *A, ...)
{
    if (!usable(A)) return null_argument(__func__);
    // Check every destination before writing any, so a null one leaves all untouched.
    std::size_t n = count(A);
    va_list ap;
    va_start(ap, A);
    bool ok = true;
    for (std::size_t i = 0; i < n; ++i) ok = ok && va_arg(ap, double *) != nullptr;
    va_end(ap);
    if (!ok) return null_argument(__func__);
    va_start(ap, A);
    for (std::size_t i = 0; i < n; ++i) *va_arg(ap, double *) = A->data[i];
    va_end(ap);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_copy(const Plx_Matrix *A, Plx_Matrix *B)
{
    if (!usable(A) || !usable(B)) return null_argument(__func__);
    if (!same_size(A, B, __func__)) return PLX_FALSE;
    if (count(A) > 0 && A->data != B->data) std::memmove(B->data, A->data, count(A) * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_scale(const Plx_Matrix *A, double s, Plx_Matrix *sA)
{
    if (!usable(A) || !usable(sA)) return null_argument(__func__);
    if (!same_size(A, sA, __func__)) return PLX_FALSE;
    for (std::size_t i = 0, n = count(A); i < n; ++i) sA->data[i] = s * A->data[i];
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_add(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C)
{
    if (!usable(A) || !usable(B) || !usable(C)) return null_argument(__func__);
    if (!same_size(A, B, __func__) || !same_size(A, C, __func__)) return PLX_FALSE;
    for (std::size_t i = 0, n = count(A); i < n; ++i) C->data[i] = A->data[i] + B->data[i];
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_sub(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C)
{
    if (!usable(A) || !usable(B) || !usable(C)) return null_argument(__func__);
    if (!same_size(A, B, __func__) || !same_size(A, C, __func__)) return PLX_FALSE;
    for (std::size_t i = 0, n = count(A); i < n; ++i) C->data[i] = A->data[i] - B->data[i];
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_gemm(double alpha, const Plx_Matrix *A, Plx_Bool transpose_A, const Plx_Matrix *B,
                              Plx_Bool transpose_B, double beta, Plx_Matrix *C)
{
    if (!usable(A) || !usable(B) || !usable(C)) return null_argument(__func__);
    uint32_t ar = transpose_A ? A->cols : A->rows, ac = transpose_A ? A->rows : A->cols;
    uint32_t br = transpose_B ? B->cols : B->rows, bc = transpose_B ? B->rows : B->cols;
    if (ac != br || C->rows != ar || C->cols != bc)
        return PLX_FAIL(__func__, PLX_ERROR_INCOMPATIBLE, "matrix sizes do not fit the product", 0);
    return plx::guarded(__func__, [&] {
        if (count(C) == 0) return true;
        // Product into a temporary: C may share memory with A or B.
        RMat P;
        if (transpose_A && transpose_B) P = map(A).transpose() * map(B).transpose();
        else if (transpose_A) P = map(A).transpose() * map(B);
        else if (transpose_B) P = map(A) * map(B).transpose();
        else P = map(A) * map(B);
        if (beta == 0.0) map(C) = alpha * P;
        else map(C) = alpha * P + beta * map(C);
        return true;
    });
}

PLX_API Plx_Bool plx_mat_mult(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C)
{
    if (plx_mat_gemm(1.0, A, 0, B, 0, 0.0, C)) return PLX_TRUE;
    PLX_ERR_PASS();
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_mat_tmult(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C)
{
    if (plx_mat_gemm(1.0, A, 1, B, 0, 0.0, C)) return PLX_TRUE;
    PLX_ERR_PASS();
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_mat_multt(const Plx_Matrix *A, const Plx_Matrix *B, Plx_Matrix *C)
{
    if (plx_mat_gemm(1.0, A, 0, B, 1, 0.0, C)) return PLX_TRUE;
    PLX_ERR_PASS();
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_mat_gemv(double alpha, const Plx_Matrix *A, Plx_Bool transpose_A, const Plx_Vector *x,
                              double beta, Plx_Vector *y)
{
    if (!usable(A) || !usable(x) || !usable(y)) return null_argument(__func__);
    uint32_t ar = transpose_A ? A->cols : A->rows, ac = transpose_A ? A->rows : A->cols;
    if (ac != x->rows || y->rows != ar)
        return PLX_FAIL(__func__, PLX_ERROR_INCOMPATIBLE, "sizes do not fit the product", 0);
    return plx::guarded(__func__, [&] {
        if (y->rows == 0) return true;
        Eigen::VectorXd p = transpose_A ? Eigen::VectorXd(map(A).transpose() * map(x)) : Eigen::VectorXd(map(A) * map(x));
        if (beta == 0.0) map(y) = alpha * p;
        else map(y) = alpha * p + beta * map(y);
        return true;
    });
}

PLX_API Plx_Bool plx_mat_multv(const Plx_Matrix *A, const Plx_Vector *x, Plx_Vector *y)
{
    if (plx_mat_gemv(1.0, A, 0, x, 0.0, y)) return PLX_TRUE;
    PLX_ERR_PASS();
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_mat_tmultv(const Plx_Matrix *A, const Plx_Vector *x, Plx_Vector *y)
{
    if (plx_mat_gemv(1.0, A, 1, x, 0.0, y)) return PLX_TRUE;
    PLX_ERR_PASS();
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_mat_transpose(const Plx_Matrix *A, Plx_Matrix *At)
{
    if (!usable(A) || !usable(At)) return null_argument(__func__);
    if (At->rows != A->cols || At->cols != A->rows)
        return PLX_FAIL(__func__, PLX_ERROR_INCOMPATIBLE, "transpose has the wrong size", 0);
    return plx::guarded(__func__, [&] {
        if (count(A) == 0) return true;
        if (plx::overlaps(A->data, count(A), At->data, count(At))) {
            RMat t = map(A).transpose();
            map(At) = t;
        } else {
            map(At) = map(A).transpose();
        }
        return true;
    });
}

PLX_API Plx_Bool plx_mat_insert(Plx_Matrix *A, uint32_t row, uint32_t col, const Plx_Matrix *B)
{
    if (!usable(A) || !usable(B)) return null_argument(__func__);
    if (uint64_t(row) + B->rows > A->rows || uint64_t(col) + B->cols > A->cols)
        return PLX_FAIL(__func__, PLX_ERROR_INCOMPATIBLE, "block does not fit", 0);
    for (uint32_t r = 0; r < B->rows; ++r)
        std::memmove(A->data + std::size_t(row + r) * A->cols + col, B->data + std::size_t(r) * B->cols,
                     B->cols * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_mat_extract(const Plx_Matrix *A, uint32_t row, uint32_t col, Plx_Matrix *B)
{
    if (!usable(A) || !usable(B)) return null_argument(__func__);
    if (uint64_t(row) + B->rows > A->rows || uint64_t(col) + B->cols > A->cols)
        return PLX_FAIL(__func__, PLX_ERROR_INCOMPATIBLE, "block does not fit", 0);
    for (uint32_t r = 0; r < B->rows; ++r)
        std::memmove(B->data + std::size_t(r) * B->cols, A->data + std::size_t(row + r) * A->cols + col,
                     B->cols * sizeof(double));
    return PLX_TRUE;
}

// ---- vectors ----

PLX_API Plx_Vector *plx_vec_form(Plx_Vector *x, uint32_t rows)
{
    return plx::form_record(x, Plx_Vector{rows, nullptr, 0, 0, 0}, rows, __func__);
}

PLX_API Plx_Vector *plx_vec_new(uint32_t rows)
{
    Plx_Vector *x = plx_vec_form(nullptr, rows);
    if (x == nullptr) PLX_ERR_PASS();
    return x;
}

PLX_API Plx_Vector *plx_vec_form_data(Plx_Vector *x, uint32_t rows, double *data)
{
    if (data == nullptr && rows > 0) {
        null_argument(__func__);
        return nullptr;
    }
    return plx::form_record(x, Plx_Vector{rows, data, rows, 0, 0}, 0, __func__);
}

PLX_API Plx_Bool plx_vec_resize(Plx_Vector *x, uint32_t rows)
{
    if (x == nullptr) return null_argument(__func__);
    if (!plx::ensure_block(x->data, x->capacity, x->data_owned, rows, __func__)) return PLX_FALSE;
    x->rows = rows;
    return PLX_TRUE;
}

PLX_API void plx_vec_free(Plx_Vector *x) { plx::free_record(x); }

PLX_API Plx_Bool plx_vec_fill_zero(Plx_Vector *x)
{
    if (!usable(x)) return null_argument(__func__);
    if (x->rows > 0) std::memset(x->data, 0, x->rows * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_fill(Plx_Vector *x, const double *values)
{
    if (!usable(x) || (values == nullptr && x->rows > 0)) return null_argument(__func__);
    if (x->rows > 0) std::memmove(x->data, values, x->rows * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_fill_va(Plx_Vector *x, ...)
{
    if (!usable(x)) return null_argument(__func__);
    va_list ap;
    va_start(ap, x);
    for (uint32_t i = 0; i < x->rows; ++i) x->data[i] = va_arg(ap, double);
    va_end(ap);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_read(const Plx_Vector *x, double *values)
{
    if (!usable(x) || (values == nullptr && x->rows > 0)) return null_argument(__func__);
    if (x->rows > 0) std::memmove(values, x->data, x->rows * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_read_va(const Plx_Vector *x, ...)
{
    if (!usable(x)) return null_argument(__func__);
    va_list ap;
    va_start(ap, x);
    bool ok = true;
    for (uint32_t i = 0; i < x->rows; ++i) ok = ok && va_arg(ap, double *) != nullptr;
    va_end(ap);
    if (!ok) return null_argument(__func__);
    va_start(ap, x);
    for (uint32_t i = 0; i < x->rows; ++i) *va_arg(ap, double *) = x->data[i];
    va_end(ap);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_copy(const Plx_Vector *x, Plx_Vector *y)
{
    if (!usable(x) || !usable(y)) return null_argument(__func__);
    if (!same_size(x, y, __func__)) return PLX_FALSE;
    if (x->rows > 0 && x->data != y->data) std::memmove(y->data, x->data, x->rows * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_scale(const Plx_Vector *x, double s, Plx_Vector *sx)
{
    if (!usable(x) || !usable(sx)) return null_argument(__func__);
    if (!same_size(x, sx, __func__)) return PLX_FALSE;
    for (uint32_t i = 0; i < x->rows; ++i) sx->data[i] = s * x->data[i];
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_add(const Plx_Vector *x, const Plx_Vector *y, Plx_Vector *z)
{
    if (!usable(x) || !usable(y) || !usable(z)) return null_argument(__func__);
    if (!same_size(x, y, __func__) || !same_size(x, z, __func__)) return PLX_FALSE;
    for (uint32_t i = 0; i < x->rows; ++i) z->data[i] = x->data[i] + y->data[i];
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_sub(const Plx_Vector *x, const Plx_Vector *y, Plx_Vector *z)
{
    if (!usable(x) || !usable(y) || !usable(z)) return null_argument(__func__);
    if (!same_size(x, y, __func__) || !same_size(x, z, __func__)) return PLX_FALSE;
    for (uint32_t i = 0; i < x->rows; ++i) z->data[i] = x->data[i] - y->data[i];
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_dot(const Plx_Vector *x, const Plx_Vector *y, double *dot)
{
    if (!usable(x) || !usable(y) || dot == nullptr) return null_argument(__func__);
    if (!same_size(x, y, __func__)) return PLX_FALSE;
    double s = 0;
    for (uint32_t i = 0; i < x->rows; ++i) s += x->data[i] * y->data[i];
    *dot = s;
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_norm(const Plx_Vector *x, double *norm)
{
    if (!usable(x) || norm == nullptr) return null_argument(__func__);
    *norm = x->rows == 0 ? 0.0 : map(x).stableNorm();  // no overflow for huge entries
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_insert(Plx_Vector *x, uint32_t pos, const Plx_Vector *y)
{
    if (!usable(x) || !usable(y)) return null_argument(__func__);
    if (uint64_t(pos) + y->rows > x->rows) return PLX_FAIL(__func__, PLX_ERROR_INCOMPATIBLE, "vector does not fit", pos);
    if (y->rows > 0) std::memmove(x->data + pos, y->data, y->rows * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_vec_extract(const Plx_Vector *x, uint32_t pos, Plx_Vector *y)
{
    if (!usable(x) || !usable(y)) return null_argument(__func__);
    if (uint64_t(pos) + y->rows > x->rows) return PLX_FAIL(__func__, PLX_ERROR_INCOMPATIBLE, "vector does not fit", pos);
    if (y->rows > 0) std::memmove(y->data, x->data + pos, y->rows * sizeof(double));
    return PLX_TRUE;
}

}  // extern "C"
