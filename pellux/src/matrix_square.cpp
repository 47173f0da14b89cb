// Square matrices with structure: forming, element access, arithmetic, factorisations.
#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>

#include <Eigen/Cholesky>
#include <Eigen/Core>
#include <Eigen/Eigenvalues>
#include <Eigen/LU>
#include <cstdarg>

#include "matrix_internal.hpp"
#include "pellux/detail/util.hpp"
#include "pellux/error.h"
#include "pellux/matrix.h"

namespace plx {

bool ensure_block(double *&data, std::size_t &capacity, uint32_t &data_owned, std::size_t n,
                  const char *function)
{
    if (data != nullptr && capacity >= n) return true;
    if (data != nullptr && !data_owned) {
        plx_err_flush_trace();
        plx_err_register_fileline(function, PLX_ERROR_INCOMPATIBLE, __FILE__, __LINE__,
                                  "size exceeds the capacity of caller-supplied data",
                                  static_cast<int64_t>(n));
        return false;
    }
    double *block = heap_alloc<double>(n, function, __FILE__, __LINE__);
    if (block == nullptr) return false;
    if (data != nullptr && capacity > 0) std::memcpy(block, data, std::min(capacity, n) * sizeof(double));
    std::free(data);
    data = block;
    capacity = n == 0 ? 1 : n;
    data_owned = 1;
    return true;
}

}  // namespace plx

namespace {

using plx::null_argument;
using plx::squmat_at;
using RMat = Eigen::Matrix<double, Eigen::Dynamic, Eigen::Dynamic, Eigen::RowMajor>;
using MapM = Eigen::Map<RMat>;
using MapCM = Eigen::Map<const RMat>;
using MapV = Eigen::Map<Eigen::VectorXd>;
using MapCV = Eigen::Map<const Eigen::VectorXd>;

bool check_type(int64_t type, const char *function)
{
    if (plx::squmat_known_type(type)) return true;
    PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "unknown square matrix type", type);
    return false;
}

inline std::size_t stored(const Plx_SquMatrix *A) { return plx::squmat_stored(A->type, A->size); }

// A record that can be read or written: present, of a known type, with data for its values.
bool check(const Plx_SquMatrix *A, const char *function)
{
    if (A == nullptr) return null_argument(function);
    if (!check_type(plx::squmat_raw_type(A), function)) return false;
    if (A->data == nullptr && stored(A) > 0) return null_argument(function);
    return true;
}

bool check(const Plx_Matrix *A, const char *function)
{
    if (A == nullptr || (A->data == nullptr && std::size_t(A->rows) * A->cols > 0)) return null_argument(function);
    return true;
}

bool check(const Plx_Vector *x, const char *function)
{
    if (x == nullptr || (x->data == nullptr && x->rows > 0)) return null_argument(function);
    return true;
}

bool size_fits(bool fits, const char *function)
{
    return fits || PLX_FAIL(function, PLX_ERROR_INCOMPATIBLE, "matrix sizes do not fit together", 0);
}

bool type_supports(bool supported, const char *function)
{
    return supported || PLX_FAIL(function, PLX_ERROR_UNSUPPORTED, "operation not supported by the matrix type", 0);
}

// Whether a matrix of type `holder` can represent every matrix of type `held`.
bool holds(Plx_SquMatrixType holder, Plx_SquMatrixType held)
{
    if (holder == held || holder == PLX_SQUMAT_GENERIC) return true;
    if (held == PLX_SQUMAT_SCALED_IDENTITY) return holder != PLX_SQUMAT_NONE;
    if (held == PLX_SQUMAT_DIAGONAL)
        return holder == PLX_SQUMAT_SYMMETRIC || holder == PLX_SQUMAT_LOWER_TRIANGULAR ||
               holder == PLX_SQUMAT_UPPER_TRIANGULAR;
    return false;
}

// The narrowest type holding both a and b.
Plx_SquMatrixType join(Plx_SquMatrixType a, Plx_SquMatrixType b)
{
    if (holds(a, b)) return a;
    if (holds(b, a)) return b;
    return PLX_SQUMAT_GENERIC;
}

Plx_SquMatrixType transposed(Plx_SquMatrixType t)
{
    if (t == PLX_SQUMAT_LOWER_TRIANGULAR) return PLX_SQUMAT_UPPER_TRIANGULAR;
    if (t == PLX_SQUMAT_UPPER_TRIANGULAR) return PLX_SQUMAT_LOWER_TRIANGULAR;
    return t;
}

bool is_triangular_like(Plx_SquMatrixType t)
{
    return t == PLX_SQUMAT_LOWER_TRIANGULAR || t == PLX_SQUMAT_UPPER_TRIANGULAR ||
           t == PLX_SQUMAT_DIAGONAL || t == PLX_SQUMAT_SCALED_IDENTITY;
}

bool is_symmetric_like(Plx_SquMatrixType t)
{
    return t == PLX_SQUMAT_SYMMETRIC || t == PLX_SQUMAT_DIAGONAL || t == PLX_SQUMAT_SCALED_IDENTITY;
}

// Writes every value C stores from f(row, col). For the full types all n x n entries are
// written, so the zeros outside a triangle come from f when C's type holds the result.
template <class F>
void write_elements(Plx_SquMatrix *C, F &&f)
{
    uint32_t n = C->size;
    switch (C->type) {
    case PLX_SQUMAT_DIAGONAL:
        for (uint32_t i = 0; i < n; ++i) C->data[i] = f(i, i);
        break;
    case PLX_SQUMAT_SCALED_IDENTITY:
        if (n > 0) C->data[0] = f(0u, 0u);
        break;
    default:
        for (uint32_t r = 0; r < n; ++r)
            for (uint32_t c = 0; c < n; ++c) C->data[std::size_t(r) * n + c] = f(r, c);
        break;
    }
}

// Scratch doubles: on the stack when few, else on the heap (code 5 under function).
class Scratch {
public:
    Scratch(std::size_t n, const char *function)
    {
        if (n <= kInline) {
            p_ = inline_;
        } else {
            heap_.reset(plx::heap_alloc<double>(n, function, __FILE__, __LINE__));
            p_ = heap_.get();
        }
    }
    explicit operator bool() const { return p_ != nullptr; }
    double *get() const { return p_; }

private:
    static constexpr std::size_t kInline = 256;
    double inline_[kInline];
    plx::HeapPtr<double> heap_;
    double *p_ = nullptr;
};

// The dense n x n matrix a square matrix stands for.
RMat dense(const Plx_SquMatrix *A)
{
    if (plx::squmat_is_full(A->type)) return MapCM(A->data, A->size, A->size);
    RMat d = RMat::Zero(A->size, A->size);
    for (uint32_t i = 0; i < A->size; ++i) d(i, i) = squmat_at(A, i, i);
    return d;
}

// Gives the output the type of a factorisation's or inverse's result, making room for it.
bool prepare_result(Plx_SquMatrix *R, Plx_SquMatrixType type, const char *function)
{
    if (!plx::ensure_block(R->data, R->capacity, R->data_owned, plx::squmat_stored(type, R->size), function))
        return false;
    R->type = type;
    return true;
}

bool diagonal_nonzero(const Plx_SquMatrix *T)
{
    for (uint32_t i = 0; i < T->size; ++i) {
        double d = squmat_at(T, i, i);
        if (d == 0.0 || !std::isfinite(d)) return false;
    }
    return true;
}

// Solves op(T) X = X in place for the m columns of the row-major n x m block X, T
// triangular (or diagonal, scaled identity) with a nonzero diagonal.
void triangular_solve(const Plx_SquMatrix *T, bool transpose, double *X, uint32_t m)
{
    const uint32_t n = T->size;
    if (!plx::squmat_is_full(T->type)) {
        for (uint32_t i = 0; i < n; ++i) {
            double inv = 1.0 / squmat_at(T, i, i);
            for (uint32_t j = 0; j < m; ++j) X[std::size_t(i) * m + j] *= inv;
        }
        return;
    }
    const double *t = T->data;
    // op(T)(i, k) = transpose ? T(k, i) : T(i, k); op(T) is lower when exactly one of
    // "T is lower" and "transposed" holds.
    auto e = [&](uint32_t i, uint32_t k) { return transpose ? t[std::size_t(k) * n + i] : t[std::size_t(i) * n + k]; };
    bool forward = (T->type == PLX_SQUMAT_LOWER_TRIANGULAR) != transpose;
    for (uint32_t s = 0; s < n; ++s) {
        uint32_t i = forward ? s : n - 1 - s;
        double *xi = X + std::size_t(i) * m;
        uint32_t k0 = forward ? 0 : i + 1, k1 = forward ? i : n;
        for (uint32_t k = k0; k < k1; ++k) {
            double f = e(i, k);
            if (f == 0.0) continue;
            const double *xk = X + std::size_t(k) * m;
            for (uint32_t j = 0; j < m; ++j) xi[j] -= f * xk[j];
        }
        double inv = 1.0 / e(i, i);
        for (uint32_t j = 0; j < m; ++j) xi[j] *= inv;
    }
}

// Adds alpha * S to the symmetric or generic A, S symmetric and given by s(i, j) for j <= i.
// The lower triangle is computed once and mirrored so a symmetric A stays exactly symmetric.
template <class F>
void add_symmetric(Plx_SquMatrix *A, double alpha, F &&s)
{
    const uint32_t n = A->size;
    double *a = A->data;
    for (uint32_t i = 0; i < n; ++i)
        for (uint32_t j = 0; j <= i; ++j) {
            double v = alpha * s(i, j);
            a[std::size_t(i) * n + j] += v;
            if (j == i) continue;
            if (A->type == PLX_SQUMAT_SYMMETRIC) a[std::size_t(j) * n + i] = a[std::size_t(i) * n + j];
            else a[std::size_t(j) * n + i] += v;
        }
}

bool updatable(const Plx_SquMatrix *A, const char *function)
{
    return type_supports(A->type == PLX_SQUMAT_SYMMETRIC || A->type == PLX_SQUMAT_GENERIC, function);
}

}  // namespace

extern "C" {

PLX_API Plx_SquMatrix *plx_squmat_form(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t size)
{
    if (!check_type(plx::squmat_raw_type(type), __func__)) return nullptr;
    return plx::form_record(A, Plx_SquMatrix{type, size, nullptr, 0, 0, 0}, plx::squmat_stored(type, size), __func__);
}

PLX_API Plx_SquMatrix *plx_squmat_new(Plx_SquMatrixType type, uint32_t size)
{
    Plx_SquMatrix *A = plx_squmat_form(nullptr, type, size);
    if (A == nullptr) PLX_ERR_PASS();
    return A;
}

PLX_API Plx_SquMatrix *plx_squmat_form_data(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t size,
                                            double *data)
{
    if (!check_type(plx::squmat_raw_type(type), __func__)) return nullptr;
    std::size_t n = plx::squmat_stored(type, size);
    if (data == nullptr && n > 0) {
        null_argument(__func__);
        return nullptr;
    }
    return plx::form_record(A, Plx_SquMatrix{type, size, data, n, 0, 0}, 0, __func__);
}

PLX_API Plx_Bool plx_squmat_resize(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t size)
{
    if (A == nullptr) return null_argument(__func__);
    if (!check_type(plx::squmat_raw_type(type), __func__)) return PLX_FALSE;
    if (!plx::ensure_block(A->data, A->capacity, A->data_owned, plx::squmat_stored(type, size), __func__))
        return PLX_FALSE;
    A->type = type;
    A->size = size;
    return PLX_TRUE;
}

PLX_API void plx_squmat_free(Plx_SquMatrix *A) { plx::free_record(A); }

PLX_API Plx_Bool plx_squmat_fill_zero(Plx_SquMatrix *A)
{
    if (!check(A, __func__)) return PLX_FALSE;
    if (stored(A) > 0) std::memset(A->data, 0, stored(A) * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_fill_scaled_identity(Plx_SquMatrix *A, double s)
{
    if (!check(A, __func__)) return PLX_FALSE;
    write_elements(A, [s](uint32_t r, uint32_t c) { return r == c ? s : 0.0; });
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_fill(Plx_SquMatrix *A, const double *values)
{
    if (!check(A, __func__)) return PLX_FALSE;
    if (values == nullptr && stored(A) > 0) return null_argument(__func__);
    const std::size_t n = A->size;
    switch (A->type) {
    case PLX_SQUMAT_SYMMETRIC:
        write_elements(A, [&](uint32_t r, uint32_t c) { return r >= c ? values[r * n + c] : values[c * n + r]; });
        break;
    case PLX_SQUMAT_LOWER_TRIANGULAR:
        write_elements(A, [&](uint32_t r, uint32_t c) { return r >= c ? values[r * n + c] : 0.0; });
        break;
    case PLX_SQUMAT_UPPER_TRIANGULAR:
        write_elements(A, [&](uint32_t r, uint32_t c) { return r <= c ? values[r * n + c] : 0.0; });
        break;
    default:
        if (stored(A) > 0) std::memmove(A->data, values, stored(A) * sizeof(double));
        break;
    }
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_fill_va(Plx_SquMatrix *A, ...)
{
    if (!check(A, __func__)) return PLX_FALSE;
    Scratch values(stored(A), __func__);
    if (!values) return PLX_FALSE;
    va_list ap;
    va_start(ap, A);
    for (std::size_t i = 0, n = stored(A); i < n; ++i) values.get()[i] = va_arg(ap, double);
    va_end(ap);
    if (plx_squmat_fill(A, values.get())) return PLX_TRUE;
    PLX_ERR_PASS();
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_squmat_read(const Plx_SquMatrix *A, double *values)
{
    if (!check(A, __func__)) return PLX_FALSE;
    if (values == nullptr && stored(A) > 0) return null_argument(__func__);
    if (stored(A) > 0) std::memmove(values, A->data, stored(A) * sizeof(double));
    return PLX_TRUE;
}

PLX_API double plx_squmat_get(const Plx_SquMatrix *A, uint32_t row, uint32_t col)
{
    if (A == nullptr || A->data == nullptr || !plx::squmat_known_type(plx::squmat_raw_type(A)) || row >= A->size || col >= A->size)
        return std::numeric_limits<double>::quiet_NaN();
    return plx::squmat_at(A, row, col);
}

PLX_API Plx_Bool plx_squmat_set(Plx_SquMatrix *A, uint32_t row, uint32_t col, double value)
{
    if (!check(A, __func__)) return PLX_FALSE;
    if (row >= A->size || col >= A->size) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "index outside the matrix", row >= A->size ? row : col);
        return PLX_FALSE;
    }
    std::size_t n = A->size;
    switch (A->type) {
    case PLX_SQUMAT_SYMMETRIC:
        A->data[row * n + col] = value;
        A->data[col * n + row] = value;
        return PLX_TRUE;
    case PLX_SQUMAT_LOWER_TRIANGULAR:
    case PLX_SQUMAT_UPPER_TRIANGULAR:
        if ((A->type == PLX_SQUMAT_LOWER_TRIANGULAR) ? col > row : col < row) break;
        A->data[row * n + col] = value;
        return PLX_TRUE;
    case PLX_SQUMAT_GENERIC:
        A->data[row * n + col] = value;
        return PLX_TRUE;
    case PLX_SQUMAT_DIAGONAL:
        if (row != col) break;
        A->data[row] = value;
        return PLX_TRUE;
    case PLX_SQUMAT_SCALED_IDENTITY:
        if (row != col) break;
        A->data[0] = value;
        return PLX_TRUE;
    default:
        break;
    }
    PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "element outside the matrix structure", 0);
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_squmat_to_mat(const Plx_SquMatrix *A, Plx_Matrix *M)
{
    if (!check(A, __func__) || !check(M, __func__)) return PLX_FALSE;
    if (!size_fits(M->rows == A->size && M->cols == A->size, __func__)) return PLX_FALSE;
    const std::size_t n = A->size;
    if (plx::squmat_is_full(A->type)) {
        if (n > 0 && M->data != A->data) std::memmove(M->data, A->data, n * n * sizeof(double));
        return PLX_TRUE;
    }
    // Diagonal values first, read before the block (which may share memory) is overwritten.
    Scratch diag(n, __func__);
    if (!diag) return PLX_FALSE;
    for (uint32_t i = 0; i < n; ++i) diag.get()[i] = squmat_at(A, i, i);
    for (std::size_t r = 0; r < n; ++r)
        for (std::size_t c = 0; c < n; ++c) M->data[r * n + c] = r == c ? diag.get()[r] : 0.0;
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_from_mat(const Plx_Matrix *M, Plx_SquMatrix *A)
{
    if (!check(A, __func__) || !check(M, __func__)) return PLX_FALSE;
    if (!size_fits(M->rows == A->size && M->cols == A->size, __func__)) return PLX_FALSE;
    if (A->type == PLX_SQUMAT_DIAGONAL) {
        for (uint32_t i = 0; i < A->size; ++i) A->data[i] = M->data[std::size_t(i) * A->size + i];
        return PLX_TRUE;
    }
    if (plx_squmat_fill(A, M->data)) return PLX_TRUE;
    PLX_ERR_PASS();
    return PLX_FALSE;
}

PLX_API Plx_Bool plx_squmat_copy(const Plx_SquMatrix *A, Plx_SquMatrix *B)
{
    if (!check(A, __func__) || !check(B, __func__)) return PLX_FALSE;
    if (!size_fits(A->size == B->size, __func__) || !type_supports(holds(B->type, A->type), __func__))
        return PLX_FALSE;
    if (A->type == B->type) {
        if (stored(A) > 0 && A->data != B->data) std::memmove(B->data, A->data, stored(A) * sizeof(double));
    } else {
        write_elements(B, [A](uint32_t r, uint32_t c) { return squmat_at(A, r, c); });
    }
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_scale(const Plx_SquMatrix *A, double s, Plx_SquMatrix *sA)
{
    if (!check(A, __func__) || !check(sA, __func__)) return PLX_FALSE;
    if (!size_fits(A->size == sA->size, __func__) || !type_supports(holds(sA->type, A->type), __func__))
        return PLX_FALSE;
    if (A->type == sA->type) {
        for (std::size_t i = 0, n = stored(A); i < n; ++i) sA->data[i] = s * A->data[i];
    } else {
        write_elements(sA, [A, s](uint32_t r, uint32_t c) { return s * squmat_at(A, r, c); });
    }
    return PLX_TRUE;
}

}  // extern "C"

namespace {

// C = A + sign B over any structures C can hold.
Plx_Bool add_or_sub(const Plx_SquMatrix *A, const Plx_SquMatrix *B, Plx_SquMatrix *C, double sign,
                    const char *function)
{
    if (!check(A, function) || !check(B, function) || !check(C, function)) return PLX_FALSE;
    if (!size_fits(A->size == B->size && A->size == C->size, function) ||
        !type_supports(holds(C->type, join(A->type, B->type)), function))
        return PLX_FALSE;
    if (A->type == C->type && B->type == C->type) {
        for (std::size_t i = 0, n = stored(C); i < n; ++i) C->data[i] = A->data[i] + sign * B->data[i];
    } else {
        write_elements(C, [&](uint32_t r, uint32_t c) { return squmat_at(A, r, c) + sign * squmat_at(B, r, c); });
    }
    return PLX_TRUE;
}

// y = op(A) x for n x m blocks of rows (a vector is m = 1), through a temporary so y may
// share memory with x.
bool multiply_block(const Plx_SquMatrix *A, bool transpose, const double *x, double *y, uint32_t m,
                    const char *function)
{
    const uint32_t n = A->size;
    return plx::guarded(function, [&] {
        if (n == 0 || m == 0) return true;
        MapCM X(x, n, m);
        MapM Y(y, n, m);
        if (!plx::squmat_is_full(A->type)) {
            RMat t = X;
            for (uint32_t i = 0; i < n; ++i) Y.row(i) = squmat_at(A, i, i) * t.row(i);
        } else if (transpose) {
            RMat t = MapCM(A->data, n, n).transpose() * X;
            Y = t;
        } else {
            RMat t = MapCM(A->data, n, n) * X;
            Y = t;
        }
        return true;
    });
}

Plx_Bool mult_vector(const Plx_SquMatrix *A, bool transpose, const Plx_Vector *x, Plx_Vector *y,
                     const char *function)
{
    if (!check(A, function) || !check(x, function) || !check(y, function)) return PLX_FALSE;
    if (!size_fits(x->rows == A->size && y->rows == A->size, function)) return PLX_FALSE;
    return multiply_block(A, transpose, x->data, y->data, 1, function);
}

Plx_Bool mult_matrix(const Plx_SquMatrix *A, bool transpose, const Plx_Matrix *B, Plx_Matrix *C,
                     const char *function)
{
    if (!check(A, function) || !check(B, function) || !check(C, function)) return PLX_FALSE;
    if (!size_fits(B->rows == A->size && C->rows == A->size && B->cols == C->cols, function)) return PLX_FALSE;
    return multiply_block(A, transpose, B->data, C->data, B->cols, function);
}

// Checks T for a triangular solve and copies the right-hand side into the output block.
bool prepare_solve(const Plx_SquMatrix *T, const double *b, double *x, std::size_t count, const char *function)
{
    if (!type_supports(is_triangular_like(T->type), function)) return false;
    if (!diagonal_nonzero(T))
        return PLX_FAIL(function, PLX_ERROR_DIVISION_BY_ZERO, "zero on the diagonal", 0);
    if (count > 0 && x != b) std::memmove(x, b, count * sizeof(double));
    return true;
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_squmat_add(const Plx_SquMatrix *A, const Plx_SquMatrix *B, Plx_SquMatrix *C)
{
    return add_or_sub(A, B, C, 1.0, __func__);
}

PLX_API Plx_Bool plx_squmat_sub(const Plx_SquMatrix *A, const Plx_SquMatrix *B, Plx_SquMatrix *C)
{
    return add_or_sub(A, B, C, -1.0, __func__);
}

PLX_API Plx_Bool plx_squmat_transpose(const Plx_SquMatrix *A, Plx_SquMatrix *At)
{
    if (!check(A, __func__) || !check(At, __func__)) return PLX_FALSE;
    if (!size_fits(A->size == At->size, __func__) || !type_supports(holds(At->type, transposed(A->type)), __func__))
        return PLX_FALSE;
    const std::size_t n = A->size;
    if (A->type != PLX_SQUMAT_GENERIC && A->type != PLX_SQUMAT_LOWER_TRIANGULAR &&
        A->type != PLX_SQUMAT_UPPER_TRIANGULAR) {
        if (plx_squmat_copy(A, At)) return PLX_TRUE;
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (plx::overlaps(A->data, stored(A), At->data, stored(At))) {
        // Same block (a generic matrix transposed in place): swap across the diagonal.
        for (std::size_t r = 0; r < n; ++r)
            for (std::size_t c = r + 1; c < n; ++c) std::swap(At->data[r * n + c], At->data[c * n + r]);
        return PLX_TRUE;
    }
    write_elements(At, [A](uint32_t r, uint32_t c) { return squmat_at(A, c, r); });
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_multv(const Plx_SquMatrix *A, const Plx_Vector *x, Plx_Vector *y)
{
    return mult_vector(A, false, x, y, __func__);
}

PLX_API Plx_Bool plx_squmat_tmultv(const Plx_SquMatrix *A, const Plx_Vector *x, Plx_Vector *y)
{
    return mult_vector(A, true, x, y, __func__);
}

PLX_API Plx_Bool plx_squmat_multm(const Plx_SquMatrix *A, const Plx_Matrix *B, Plx_Matrix *C)
{
    return mult_matrix(A, false, B, C, __func__);
}

PLX_API Plx_Bool plx_squmat_tmultm(const Plx_SquMatrix *A, const Plx_Matrix *B, Plx_Matrix *C)
{
    return mult_matrix(A, true, B, C, __func__);
}

PLX_API Plx_Bool plx_squmat_quadform(const Plx_SquMatrix *A, const Plx_Vector *x, double *value)
{
    if (!check(A, __func__) || !check(x, __func__)) return PLX_FALSE;
    if (value == nullptr) return null_argument(__func__);
    if (!size_fits(x->rows == A->size, __func__)) return PLX_FALSE;
    const std::size_t n = A->size;
    double q = 0;
    if (plx::squmat_is_full(A->type)) {
        for (std::size_t r = 0; r < n; ++r) {
            double s = 0;
            for (std::size_t c = 0; c < n; ++c) s += A->data[r * n + c] * x->data[c];
            q += x->data[r] * s;
        }
    } else {
        for (uint32_t i = 0; i < n; ++i) q += squmat_at(A, i, i) * x->data[i] * x->data[i];
    }
    *value = q;
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_add_rank(Plx_SquMatrix *A, double alpha, const Plx_Matrix *B)
{
    if (!check(A, __func__) || !check(B, __func__) || !updatable(A, __func__)) return PLX_FALSE;
    if (!size_fits(B->cols == A->size, __func__)) return PLX_FALSE;
    const std::size_t m = B->rows, n = B->cols;
    const double *b = B->data;
    add_symmetric(A, alpha, [&](uint32_t i, uint32_t j) {
        double s = 0;
        for (std::size_t k = 0; k < m; ++k) s += b[k * n + i] * b[k * n + j];
        return s;
    });
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_add_outer(Plx_SquMatrix *A, double alpha, const Plx_Vector *x)
{
    if (!check(A, __func__) || !check(x, __func__) || !updatable(A, __func__)) return PLX_FALSE;
    if (!size_fits(x->rows == A->size, __func__)) return PLX_FALSE;
    const double *v = x->data;
    add_symmetric(A, alpha, [v](uint32_t i, uint32_t j) { return v[i] * v[j]; });
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_add_sandwich(Plx_SquMatrix *A, double alpha, const Plx_Matrix *J,
                                         const Plx_SquMatrix *N)
{
    if (!check(A, __func__) || !check(J, __func__) || !check(N, __func__) || !updatable(A, __func__))
        return PLX_FALSE;
    if (!type_supports(is_symmetric_like(N->type), __func__)) return PLX_FALSE;
    if (!size_fits(J->cols == A->size && J->rows == N->size, __func__)) return PLX_FALSE;
    const std::size_t m = J->rows, n = J->cols;
    // NJ = N J, then A += alpha J^T (NJ).
    Scratch nj(m * n, __func__);
    if (!nj) return PLX_FALSE;
    const double *j = J->data;
    double *p = nj.get();
    if (N->type == PLX_SQUMAT_SYMMETRIC) {
        for (std::size_t r = 0; r < m; ++r) {
            double *pr = p + r * n;
            std::fill(pr, pr + n, 0.0);
            for (std::size_t k = 0; k < m; ++k) {
                double w = N->data[r * m + k];
                if (w == 0.0) continue;
                const double *jk = j + k * n;
                for (std::size_t c = 0; c < n; ++c) pr[c] += w * jk[c];
            }
        }
    } else {
        for (std::size_t r = 0; r < m; ++r) {
            double w = squmat_at(N, uint32_t(r), uint32_t(r));
            for (std::size_t c = 0; c < n; ++c) p[r * n + c] = w * j[r * n + c];
        }
    }
    add_symmetric(A, alpha, [&](uint32_t a, uint32_t b) {
        double s = 0;
        for (std::size_t k = 0; k < m; ++k) s += j[k * n + a] * p[k * n + b];
        return s;
    });
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_cholesky(const Plx_SquMatrix *A, Plx_SquMatrix *L)
{
    if (!check(A, __func__)) return PLX_FALSE;
    if (L == nullptr) return null_argument(__func__);
    if (!type_supports(is_symmetric_like(A->type), __func__)) return PLX_FALSE;
    if (!size_fits(A->size == L->size, __func__)) return PLX_FALSE;
    const std::size_t n = A->size;
    if (A->type != PLX_SQUMAT_SYMMETRIC) {
        for (std::size_t i = 0, k = stored(A); i < k; ++i)
            if (!(A->data[i] > 0.0) || !std::isfinite(A->data[i]))
                return PLX_FAIL(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "matrix not positive definite", i);
        Plx_SquMatrixType type = A->type;
        std::size_t k = stored(A);
        Scratch root(k, __func__);
        if (!root) return PLX_FALSE;
        for (std::size_t i = 0; i < k; ++i) root.get()[i] = std::sqrt(A->data[i]);
        if (!prepare_result(L, type, __func__)) return PLX_FALSE;
        std::memcpy(L->data, root.get(), k * sizeof(double));
        return PLX_TRUE;
    }
    // Factorise a copy of the lower triangle so a failure leaves A and L untouched.
    Scratch w(n * n, __func__);
    if (!w) return PLX_FALSE;
    double *l = w.get();
    for (std::size_t r = 0; r < n; ++r)
        for (std::size_t c = 0; c < n; ++c) l[r * n + c] = c <= r ? A->data[r * n + c] : 0.0;
    for (std::size_t j = 0; j < n; ++j) {
        double *lj = l + j * n;
        double d = lj[j];
        for (std::size_t k = 0; k < j; ++k) d -= lj[k] * lj[k];
        if (!(d > 0.0) || !std::isfinite(d))
            return PLX_FAIL(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "matrix not positive definite", j);
        double ljj = std::sqrt(d);
        lj[j] = ljj;
        for (std::size_t i = j + 1; i < n; ++i) {
            double *li = l + i * n;
            double s = li[j];
            for (std::size_t k = 0; k < j; ++k) s -= li[k] * lj[k];
            li[j] = s / ljj;
        }
    }
    if (!prepare_result(L, PLX_SQUMAT_LOWER_TRIANGULAR, __func__)) return PLX_FALSE;
    std::memcpy(L->data, l, n * n * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_trisolve_v(const Plx_SquMatrix *T, Plx_Bool transpose, const Plx_Vector *b,
                                       Plx_Vector *x)
{
    if (!check(T, __func__) || !check(b, __func__) || !check(x, __func__)) return PLX_FALSE;
    if (!size_fits(b->rows == T->size && x->rows == T->size, __func__)) return PLX_FALSE;
    if (!prepare_solve(T, b->data, x->data, b->rows, __func__)) return PLX_FALSE;
    triangular_solve(T, transpose != 0, x->data, 1);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_trisolve_m(const Plx_SquMatrix *T, Plx_Bool transpose, const Plx_Matrix *B,
                                       Plx_Matrix *X)
{
    if (!check(T, __func__) || !check(B, __func__) || !check(X, __func__)) return PLX_FALSE;
    if (!size_fits(B->rows == T->size && X->rows == T->size && B->cols == X->cols, __func__)) return PLX_FALSE;
    if (!prepare_solve(T, B->data, X->data, std::size_t(B->rows) * B->cols, __func__)) return PLX_FALSE;
    triangular_solve(T, transpose != 0, X->data, X->cols);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_cholesky_invert(const Plx_SquMatrix *L, Plx_SquMatrix *Ainv)
{
    if (!check(L, __func__)) return PLX_FALSE;
    if (Ainv == nullptr) return null_argument(__func__);
    if (!type_supports(L->type == PLX_SQUMAT_LOWER_TRIANGULAR || L->type == PLX_SQUMAT_DIAGONAL ||
                           L->type == PLX_SQUMAT_SCALED_IDENTITY,
                       __func__))
        return PLX_FALSE;
    if (!size_fits(L->size == Ainv->size, __func__)) return PLX_FALSE;
    if (!diagonal_nonzero(L)) return PLX_FAIL(__func__, PLX_ERROR_DIVISION_BY_ZERO, "zero on the diagonal", 0);
    const std::size_t n = L->size;
    if (L->type != PLX_SQUMAT_LOWER_TRIANGULAR) {
        std::size_t k = stored(L);
        Scratch v(k, __func__);
        if (!v) return PLX_FALSE;
        for (std::size_t i = 0; i < k; ++i) v.get()[i] = 1.0 / (L->data[i] * L->data[i]);
        if (!prepare_result(Ainv, L->type, __func__)) return PLX_FALSE;
        std::memcpy(Ainv->data, v.get(), k * sizeof(double));
        return PLX_TRUE;
    }
    // L^-1 column by column (rows of the identity solved in place), then L^-T L^-1.
    Scratch w(2 * n * n, __func__);
    if (!w) return PLX_FALSE;
    double *li = w.get(), *out = w.get() + n * n;
    for (std::size_t r = 0; r < n; ++r)
        for (std::size_t c = 0; c < n; ++c) li[r * n + c] = r == c ? 1.0 : 0.0;
    triangular_solve(L, false, li, uint32_t(n));
    for (std::size_t r = 0; r < n; ++r)
        for (std::size_t c = 0; c <= r; ++c) {
            double s = 0;
            for (std::size_t k = r; k < n; ++k) s += li[k * n + r] * li[k * n + c];
            out[r * n + c] = out[c * n + r] = s;
        }
    if (!prepare_result(Ainv, PLX_SQUMAT_SYMMETRIC, __func__)) return PLX_FALSE;
    std::memcpy(Ainv->data, out, n * n * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_invert(const Plx_SquMatrix *A, Plx_SquMatrix *Ainv)
{
    if (!check(A, __func__)) return PLX_FALSE;
    if (Ainv == nullptr) return null_argument(__func__);
    if (!size_fits(A->size == Ainv->size, __func__)) return PLX_FALSE;
    const uint32_t n = A->size;
    if (A->type == PLX_SQUMAT_SYMMETRIC) {
        // Factor into scratch, then invert from the factor.
        Scratch w(std::size_t(n) * n, __func__);
        if (!w) return PLX_FALSE;
        Plx_SquMatrix L{PLX_SQUMAT_SYMMETRIC, n, w.get(), std::size_t(n) * n, 0, 0};
        if (plx_squmat_cholesky(A, &L) && plx_squmat_cholesky_invert(&L, Ainv)) return PLX_TRUE;
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (A->type == PLX_SQUMAT_GENERIC) {
        return plx::guarded(__func__, [&] {
            Eigen::FullPivLU<RMat> lu(MapCM(A->data, n, n));
            if (!lu.isInvertible())
                return PLX_FAIL(__func__, PLX_ERROR_DIVISION_BY_ZERO, "singular matrix", 0);
            RMat inv = lu.inverse();
            if (!inv.allFinite()) return PLX_FAIL(__func__, PLX_ERROR_DIVISION_BY_ZERO, "singular matrix", 0);
            if (!prepare_result(Ainv, PLX_SQUMAT_GENERIC, __func__)) return false;
            MapM(Ainv->data, n, n) = inv;
            return true;
        });
    }
    // Triangular, diagonal, scaled identity: solve against the identity.
    if (!diagonal_nonzero(A)) return PLX_FAIL(__func__, PLX_ERROR_DIVISION_BY_ZERO, "singular matrix", 0);
    std::size_t k = stored(A);
    Scratch w(plx::squmat_is_full(A->type) ? std::size_t(n) * n : k, __func__);
    if (!w) return PLX_FALSE;
    double *x = w.get();
    if (plx::squmat_is_full(A->type)) {
        for (std::size_t r = 0; r < n; ++r)
            for (std::size_t c = 0; c < n; ++c) x[r * n + c] = r == c ? 1.0 : 0.0;
        triangular_solve(A, false, x, n);
    } else {
        for (std::size_t i = 0; i < k; ++i) x[i] = 1.0 / A->data[i];
    }
    if (!prepare_result(Ainv, A->type, __func__)) return PLX_FALSE;
    std::memcpy(Ainv->data, x, k * sizeof(double));
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_squmat_eigen(const Plx_SquMatrix *A, Plx_Vector *values, Plx_Matrix *vectors)
{
    if (!check(A, __func__) || !check(values, __func__) || !check(vectors, __func__)) return PLX_FALSE;
    if (!type_supports(is_symmetric_like(A->type), __func__)) return PLX_FALSE;
    const uint32_t n = A->size;
    if (!size_fits(values->rows == n && vectors->rows == n && vectors->cols == n, __func__)) return PLX_FALSE;
    return plx::guarded(__func__, [&] {
        if (n == 0) return true;
        RMat d = dense(A);
        if (!d.allFinite()) return PLX_FAIL(__func__, PLX_ERROR_NO_CONVERGENCE, "matrix not finite", 0);
        Eigen::SelfAdjointEigenSolver<Eigen::MatrixXd> solver(d);
        if (solver.info() != Eigen::Success)
            return PLX_FAIL(__func__, PLX_ERROR_NO_CONVERGENCE, "eigen-decomposition did not converge", 0);
        Eigen::MatrixXd v = solver.eigenvectors();
        for (uint32_t c = 0; c < n; ++c) {
            Eigen::Index big;
            v.col(c).cwiseAbs().maxCoeff(&big);
            if (v(big, c) < 0) v.col(c) = -v.col(c);
        }
        MapV(values->data, n) = solver.eigenvalues();
        MapM(vectors->data, n, n) = v;
        return true;
    });
}

}  // extern "C"
