// Shared helpers of the general and square matrix code (not part of the C interface).
#ifndef PELLUX_SRC_MATRIX_INTERNAL_HPP
#define PELLUX_SRC_MATRIX_INTERNAL_HPP

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <new>

#include "pellux/detail/util.hpp"
#include "pellux/error.h"

#include "pellux/matrix.h"

namespace plx {

// Doubles stored by a square matrix of the given structure and size; 0 for an unknown type.
inline std::size_t squmat_stored(Plx_SquMatrixType type, uint32_t size)
{
    switch (type) {
    case PLX_SQUMAT_SYMMETRIC:
    case PLX_SQUMAT_LOWER_TRIANGULAR:
    case PLX_SQUMAT_UPPER_TRIANGULAR:
    case PLX_SQUMAT_GENERIC:
        return std::size_t(size) * size;
    case PLX_SQUMAT_DIAGONAL:
        return size;
    case PLX_SQUMAT_SCALED_IDENTITY:
        return 1;
    default:
        return 0;
    }
}

inline bool squmat_known_type(int64_t type)
{
    return type >= PLX_SQUMAT_SYMMETRIC && type <= PLX_SQUMAT_GENERIC;
}

// The type field of a record as the integer the caller stored: a C caller may store any
// value, and loading one outside the enumeration as the C++ enum type is undefined.
inline int32_t squmat_raw_type(const Plx_SquMatrixType &type)
{
    static_assert(sizeof(Plx_SquMatrixType) == sizeof(int32_t));
    int32_t raw;
    std::memcpy(&raw, &type, sizeof raw);
    return raw;
}
inline int32_t squmat_raw_type(const Plx_SquMatrix *A) { return squmat_raw_type(A->type); }

// True when the structure keeps all n x n values in a full row-major array.
inline bool squmat_is_full(Plx_SquMatrixType type)
{
    return type == PLX_SQUMAT_SYMMETRIC || type == PLX_SQUMAT_LOWER_TRIANGULAR ||
           type == PLX_SQUMAT_UPPER_TRIANGULAR || type == PLX_SQUMAT_GENERIC;
}

// Element (r, c) of a square matrix of any known structure (no checks).
inline double squmat_at(const Plx_SquMatrix *A, uint32_t r, uint32_t c)
{
    switch (A->type) {
    case PLX_SQUMAT_DIAGONAL:
        return r == c ? A->data[r] : 0.0;
    case PLX_SQUMAT_SCALED_IDENTITY:
        return r == c ? A->data[0] : 0.0;
    default:
        return A->data[std::size_t(r) * A->size + c];
    }
}

// Makes a block of n doubles for a record, reusing `data` when its capacity suffices (an
// unowned block may be reused but never replaced: code 7). A replaced block's values are
// carried over as far as they fit. Registers code 5 under function on failure.
bool ensure_block(double *&data, std::size_t &capacity, uint32_t &data_owned, std::size_t n,
                  const char *function);

// Fills a record (in caller storage, or on the heap when r is null) with value, first
// allocating n doubles for it unless value already has data (caller data: never freed here).
template <class Rec>
Rec *form_record(Rec *r, Rec value, std::size_t n, const char *function)
{
    if (value.data == nullptr &&
        !plx::ensure_block(value.data, value.capacity, value.data_owned, n, function))
        return nullptr;
    if (r == nullptr) {
        r = plx::heap_alloc<Rec>(1, function, __FILE__, __LINE__);
        if (r == nullptr) {
            if (value.data_owned) std::free(value.data);
            return nullptr;
        }
        value.owned = 1;
    }
    *r = value;
    return r;
}

// Releases what a record owns, and the record itself when it came from the heap.
template <class Rec>
void free_record(Rec *r)
{
    if (r == nullptr) return;
    if (r->data_owned) std::free(r->data);
    r->data = nullptr;
    r->capacity = 0;
    r->data_owned = 0;
    if (r->owned) std::free(r);
}

// Starts a failure under the exported function's name; evaluates to false.
#define PLX_FAIL(function, code, message, number) \
    (PLX_ERR_START_AS((function), (code), (message), (number)), false)
inline bool null_argument(const char *function)
{
    return PLX_FAIL(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
}

// Runs body (returning bool) and turns an allocation failure inside Eigen into code 5, so no
// exception leaves the library.
template <class F>
Plx_Bool guarded(const char *function, F &&body)
{
    try {
        return body() ? PLX_TRUE : PLX_FALSE;
    } catch (const std::bad_alloc &) {
        (void)PLX_FAIL(function, PLX_ERROR_MALLOC_FAILED, "temporary matrix", 0);
        return PLX_FALSE;
    }
}

// True when the two blocks of doubles overlap.
inline bool overlaps(const double *a, std::size_t na, const double *b, std::size_t nb)
{
    return a != nullptr && b != nullptr && a < b + nb && b < a + na;
}

}  // namespace plx

#endif
