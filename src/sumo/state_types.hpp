// Pieces shared by the optimiser's standard state types: giving a state its dimension, the
// initialisers every type runs through, heap copies of objects in the user data, the choice
// of the fixed entry of minimal types and the column selection of the Jacobian fillers.
#ifndef PLANO_SRC_SUMO_STATE_TYPES_HPP
#define PLANO_SRC_SUMO_STATE_TYPES_HPP

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "plano/sumo_states.h"
#include "sumo/sumo_internal.hpp"

namespace sumo_states {

// Registers the origin of a failure under `function`.
inline void fail(const char *function, int32_t code, const char *message, int64_t number = 0)
{
    PLX_ERR_START_AS(function, code, message, number);
}
inline void pass(const char *function)
{
    plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
}

// Copy function for user data of a fixed size (SumoUserCopy).
template <std::size_t Bytes>
void *copy_bytes(void *data)
{
    if (data == nullptr) return nullptr;
    void *p = std::malloc(Bytes);
    if (p != nullptr) std::memcpy(p, data, Bytes);
    return p;
}

// A heap copy of `bytes` of object, or null on failure (code 5 with the size).
void *heap_copy(const void *object, std::size_t bytes, const char *function);
// Replaces the state's user data by data (owned, freed with free, copied with copy).
void set_user_data(SumoStateVector *s, void *data, SumoUserCopy copy);
void free_user_data(SumoStateVector *s);

// Checks the arguments of an initialiser: null pointers code 32, an eliminated state code 7,
// a dimension the state cannot take code 7 (see prepare_dimension).
bool check_init(Sumo *sumo, SumoStateVector *s, uint32_t n, const char *function);
// Gives the state dimension n: blocks are dropped and the prior is discarded, the parameter
// values are left as they lie. check_init must have passed.
bool set_dimension(Sumo *sumo, SumoStateVector *s, uint32_t n, const char *function);

// The common initialiser: dimension n, type code, parameters x (n values), state
// initialised, and for scale != null one scale observation (unless the state has one).
bool init_state(Sumo *sumo, SumoStateVector *s, int32_t type, const double *x, uint32_t n, SumoHFunction scale,
                const char *function);
// The fixed initialiser: dimension 0, type code, user data a heap copy of `bytes` of object
// (none for a null object), freed with free and copied with copy.
bool init_fixed(Sumo *sumo, SumoStateVector *s, int32_t type, const void *object, std::size_t bytes,
                SumoUserCopy copy, const char *function);

// Index of the entry to fix at 1: the largest value, entry 1 winning a tie with entry 0 and
// later entries needing to be strictly greater. When that largest value is 0 the most
// negative entry is taken instead, by the same rule on the negated values (the object is
// defined up to scale, so a sign flip is harmless where a zero divisor is not).
uint32_t choose_fixed_entry(const double *v, uint32_t n);

// J (resized to rows x n) from `rows` rows of k derivatives (row-major in d): column j of J is
// column cols[j] of d, times scale when scale is not 1. Null J or d: code 32.
bool fill_columns(Plx_Matrix *J, const double *d, uint32_t rows, uint32_t k, const uint32_t *cols, uint32_t n,
                  double scale, const char *function);
// The same from an m x k matrix.
bool fill_columns_matrix(Plx_Matrix *J, const Plx_Matrix *d, uint32_t k, const uint32_t *cols, uint32_t n,
                         double scale, const char *function);

// The scale function shared by the homogeneous types: h = x^T x, dh/dx = 2 x^T.
Plx_Bool scale_h(SumoStateVector **states, uint32_t n_states, Plx_Vector *h, Plx_Matrix **jacobians,
                 const char *function);

// ---- homogeneous families (homography, homogeneous points, lines) ----
// A family of K entries known up to scale: the full code normalises to unit norm, the fixed
// code keeps a copy of the K entries (as doubles) in the user data, minimal codes
// minimal0 + j fix entry j at 1; plain (0: none) is a Euclidean code whose last entry is 1.
struct Family {
    uint32_t K;
    int32_t full, fixed, minimal0, plain;
    SumoHFunction scale;
    const double *fixed_default;  // object of a fixed state without data; null: code 31
};

// Dimension of the family's code, or -1 when the code is not the family's.
int family_dim(const Family &f, int32_t type);
// Parameters for the code from the object (K values); 12 for a foreign code, 18 for a zero
// norm or divisor.
bool family_params(const Family &f, int32_t type, const double *object, double *x, const char *function);
// The object (K values) from the state.
bool family_read(const Family &f, const SumoStateVector *s, double *object, const char *function);
// Columns kept by the Jacobian fillers; -1 for a foreign code.
int family_columns(const Family &f, int32_t type, uint32_t *cols);
bool family_init(const Family &f, Sumo *sumo, SumoStateVector *s, const double *object, const char *function);
bool family_init_fixed(const Family &f, Sumo *sumo, SumoStateVector *s, const double *object,
                       const char *function);
bool family_init_minimal(const Family &f, Sumo *sumo, SumoStateVector *s, const double *object,
                         const char *function);
bool family_reset(const Family &f, SumoStateVector *s, const double *object, const char *function);
bool family_fill(const Family &f, Plx_Matrix *J, const double *d, uint32_t rows, double scale, int32_t type,
                 const char *function);

// Code 32 unless the n values are finite.
bool check_finite(const double *v, uint32_t n, const char *function);

// Null state check of Read and Reset (code 32).
inline bool check_state(const SumoStateVector *s, const void *object, const char *function)
{
    if (s == nullptr || object == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return false;
    }
    return true;
}

}  // namespace sumo_states

#endif
