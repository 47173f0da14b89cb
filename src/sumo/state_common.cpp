// What the standard state types share: dimensions, initialisers, user data, the fixed-entry
// choice, Jacobian column selection, the scale observation and the homogeneous families.
#include <cmath>

#include "pellux/detail/util.hpp"
#include "sumo/state_types.hpp"

using namespace sumo;

namespace sumo_states {

namespace {

bool vec_fits(const Plx_Vector &v, std::size_t n) { return v.capacity >= n || v.data_owned; }
bool squ_fits(const Plx_SquMatrix &A, std::size_t n) { return A.capacity >= n * n || A.data_owned; }

// Every size-dependent array of the state, resized to n; returns false at the first failure.
bool resize_arrays(SumoStateVector *s, uint32_t n, uint32_t T)
{
    bool ok = plx_vec_resize(&s->x_old, n) && plx_vec_resize(&s->b, n) && plx_vec_resize(&s->b_work, n) &&
              plx_squmat_resize(&s->A, s->A.type, n) && plx_squmat_resize(&s->A_work, s->A_work.type, n) &&
              plx_squmat_resize(&s->covariance, s->covariance.type, n);
    for (uint32_t t = 0; ok && t < T && s->thread_blocks != nullptr; ++t)
        ok = plx_squmat_resize(&s->thread_blocks[t].A, s->thread_blocks[t].A.type, n) &&
             plx_vec_resize(&s->thread_blocks[t].b, n);
    return ok && plx_vec_resize(&s->x.v, n);
}

// True when the observation is a scale observation on this state alone.
bool is_scale_obs(const SumoObs *o, const SumoStateVector *s)
{
    if (o->n_states != 1 || o->states[0] != s || o->kind != SUMO_OBS_H) return false;
    const SumoHFunction h = o->func.h;
    return h == bSumoHomog33ScaleH || h == bPoint2DHScaleH || h == bPoint3DHScaleH || h == bLine2DHScaleH;
}

SumoObs *find_scale_obs(const SumoStateVector *s)
{
    for (SumoObs *o = s->obs_active; o != nullptr; o = o->next_in_state[slot_of(o, s)])
        if (is_scale_obs(o, s)) return o;
    return nullptr;
}

// A state re-initialised as a type without a free scale loses its scale observation: held at
// unit norm, minimal or Euclidean parameters would be pulled off their solution.
void drop_scale_obs(Sumo *sumo, SumoStateVector *s)
{
    while (SumoObs *o = find_scale_obs(s)) {
        obs_unlink_states(o, false);
        obs_unlink_sumo(sumo, o, false);
        vSumoObsFree(o);
        sumo->modified = 1;
    }
}

}  // namespace

void *heap_copy(const void *object, std::size_t bytes, const char *function)
{
    void *p = plx::heap_alloc<unsigned char>(bytes, function, __FILE__, __LINE__);
    if (p != nullptr) std::memcpy(p, object, bytes);
    return p;
}

void free_user_data(SumoStateVector *s)
{
    if (s->x.user_free != nullptr && s->x.user_data != nullptr) s->x.user_free(s->x.user_data);
    s->x.user_data = nullptr;
    s->x.user_free = nullptr;
    s->x.user_copy = nullptr;
}

void set_user_data(SumoStateVector *s, void *data, SumoUserCopy copy)
{
    free_user_data(s);
    s->x.user_data = data;
    s->x.user_free = data != nullptr ? std::free : nullptr;
    s->x.user_copy = data != nullptr ? copy : nullptr;
}

bool check_init(Sumo *sumo, SumoStateVector *s, uint32_t n, const char *function)
{
    if (sumo == nullptr || s == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return false;
    }
    if (s->status == SUMO_STATE_ELIMINATED) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state is eliminated");
        return false;
    }
    if (dim(s) == n) return true;
    // Eliminated observations and states have left information sized for the old dimension.
    if (s->obs_eliminated != nullptr || s->elim_blocks.head != nullptr) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state holds eliminated information of another dimension", dim(s));
        return false;
    }
    bool fits = vec_fits(s->x.v, n) && vec_fits(s->x_old, n) && vec_fits(s->b, n) && vec_fits(s->b_work, n) &&
                squ_fits(s->A, n) && squ_fits(s->A_work, n) && squ_fits(s->covariance, n);
    for (uint32_t t = 0; fits && t < sumo->n_threads && s->thread_blocks != nullptr; ++t)
        fits = squ_fits(s->thread_blocks[t].A, n) && vec_fits(s->thread_blocks[t].b, n);
    if (!fits) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state from a memory stack is too small", dim(s));
        return false;
    }
    return true;
}

bool set_dimension(Sumo *sumo, SumoStateVector *s, uint32_t n, const char *function)
{
    const uint32_t old = dim(s);
    if (old == n) return true;
    drop_state_blocks(s);
    s->covariance_valid = 0;
    sumo->indices_valid = 0;
    if (!resize_arrays(s, n, sumo->n_threads)) {
        // Shrinking back never allocates.
        resize_arrays(s, old, sumo->n_threads);
        pass(function);
        return false;
    }
    return true;
}

bool init_state(Sumo *sumo, SumoStateVector *s, int32_t type, const double *x, uint32_t n, SumoHFunction scale,
                const char *function)
{
    if (!check_init(sumo, s, n, function) || !check_finite(x, n, function) || !set_dimension(sumo, s, n, function))
        return false;
    s->x.type = type;
    if (n > 0) std::memcpy(s->x.v.data, x, sizeof(double) * n);
    if (!bSumoStateVectorInit(sumo, s, nullptr)) {
        pass(function);
        return false;
    }
    if (scale == nullptr) drop_scale_obs(sumo, s);
    if (scale != nullptr && find_scale_obs(s) == nullptr) {
        double one = 1.0, info = 1000.0;
        Plx_Vector z;
        Plx_SquMatrix Ni;
        plx_vec_form_data(&z, 1, &one);
        plx_squmat_form_data(&Ni, PLX_SQUMAT_DIAGONAL, 1, &info);
        if (pSumoObsH(sumo, &z, &Ni, scale, nullptr, &s, 1) == nullptr) {
            pass(function);
            return false;
        }
    }
    return true;
}

bool init_fixed(Sumo *sumo, SumoStateVector *s, int32_t type, const void *object, std::size_t bytes,
                SumoUserCopy copy, const char *function)
{
    if (!check_init(sumo, s, 0, function)) return false;
    void *data = nullptr;
    if (object != nullptr && (data = heap_copy(object, bytes, function)) == nullptr) return false;
    if (!set_dimension(sumo, s, 0, function)) {
        std::free(data);
        return false;
    }
    s->x.type = type;
    set_user_data(s, data, copy);
    drop_scale_obs(sumo, s);
    if (!bSumoStateVectorInit(sumo, s, nullptr)) {
        pass(function);
        return false;
    }
    return true;
}

bool check_finite(const double *v, uint32_t n, const char *function)
{
    for (uint32_t i = 0; i < n; ++i)
        if (!std::isfinite(v[i])) {
            fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "non-finite value", i);
            return false;
        }
    return true;
}

uint32_t choose_fixed_entry(const double *v, uint32_t n)
{
    auto choose = [&](double sign) {
        uint32_t best = sign * v[0] > sign * v[1] ? 0 : 1;
        for (uint32_t i = 2; i < n; ++i)
            if (sign * v[i] > sign * v[best]) best = i;
        return best;
    };
    const uint32_t best = choose(1.0);
    return v[best] == 0.0 ? choose(-1.0) : best;
}

bool fill_columns(Plx_Matrix *J, const double *d, uint32_t rows, uint32_t k, const uint32_t *cols, uint32_t n,
                  double scale, const char *function)
{
    if (J == nullptr || d == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return false;
    }
    if (!plx_mat_resize(J, rows, n)) {
        pass(function);
        return false;
    }
    for (uint32_t r = 0; r < rows; ++r)
        for (uint32_t j = 0; j < n; ++j) {
            const double value = d[std::size_t(r) * k + cols[j]];
            J->data[std::size_t(r) * n + j] = scale != 1.0 ? value * scale : value;
        }
    return true;
}

bool fill_columns_matrix(Plx_Matrix *J, const Plx_Matrix *d, uint32_t k, const uint32_t *cols, uint32_t n,
                         double scale, const char *function)
{
    if (J == nullptr || d == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return false;
    }
    if (d->cols != k) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "derivative matrix has the wrong number of columns", d->cols);
        return false;
    }
    if (J == d) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "output aliases the derivatives");
        return false;
    }
    return fill_columns(J, d->data, d->rows, k, cols, n, scale, function);
}

Plx_Bool scale_h(SumoStateVector **states, uint32_t n_states, Plx_Vector *h, Plx_Matrix **jacobians,
                 const char *function)
{
    if (states == nullptr || n_states < 1 || states[0] == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "no state");
        return PLX_FALSE;
    }
    const SumoStateVector *s = states[0];
    const uint32_t n = dim(s);
    const double *x = s->x.v.data;
    if (h != nullptr) {
        if (h->rows != 1) {
            fail(function, PLX_ERROR_INCOMPATIBLE, "scale observation has one entry", h->rows);
            return PLX_FALSE;
        }
        double sum = 0.0;
        for (uint32_t i = 0; i < n; ++i) sum += x[i] * x[i];
        h->data[0] = sum;
    }
    if (jacobians != nullptr && jacobians[0] != nullptr) {
        if (!plx_mat_resize(jacobians[0], 1, n)) {
            pass(function);
            return PLX_FALSE;
        }
        for (uint32_t i = 0; i < n; ++i) jacobians[0]->data[i] = 2.0 * x[i];
    }
    return PLX_TRUE;
}

// ---- homogeneous families ----

int family_dim(const Family &f, int32_t type)
{
    if (type == f.full) return int(f.K);
    if (type == f.fixed) return 0;
    if (f.plain != 0 && type == f.plain) return int(f.K) - 1;
    if (f.minimal0 != 0 && type >= f.minimal0 && type < f.minimal0 + int32_t(f.K)) return int(f.K) - 1;
    return -1;
}

bool family_params(const Family &f, int32_t type, const double *object, double *x, const char *function)
{
    const uint32_t K = f.K;
    if (family_dim(f, type) < 0) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
    if (type == f.fixed) return true;
    if (!check_finite(object, K, function)) return false;
    if (type == f.full) {
        double sum = 0.0;
        for (uint32_t i = 0; i < K; ++i) sum += object[i] * object[i];
        const double norm = std::sqrt(sum);
        if (!(norm > 0.0)) {
            fail(function, PLX_ERROR_DIVISION_BY_ZERO, "zero norm");
            return false;
        }
        for (uint32_t i = 0; i < K; ++i) x[i] = object[i] / norm;
        return true;
    }
    // Plain codes fix the last entry; minimal codes the chosen one.
    const uint32_t k = type == f.plain ? K - 1 : uint32_t(type - f.minimal0);
    if (object[k] == 0.0) {
        fail(function, PLX_ERROR_DIVISION_BY_ZERO, "fixed entry is zero", k);
        return false;
    }
    for (uint32_t i = 0, j = 0; i < K; ++i)
        if (i != k) x[j++] = object[i] / object[k];
    return true;
}

bool family_read(const Family &f, const SumoStateVector *s, double *object, const char *function)
{
    const int32_t type = s->x.type;
    const int n = family_dim(f, type);
    if (n < 0) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
    const uint32_t K = f.K;
    if (type == f.fixed) {
        const double *stored = static_cast<const double *>(s->x.user_data);
        if (stored == nullptr) stored = f.fixed_default;
        if (stored == nullptr) {
            fail(function, PLX_ERROR_NOT_INITIALISED, "fixed state without data");
            return false;
        }
        std::memcpy(object, stored, sizeof(double) * K);
        return true;
    }
    if (dim(s) != uint32_t(n)) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state dimension does not fit its type", dim(s));
        return false;
    }
    const double *x = s->x.v.data;
    if (type == f.full) {
        std::memcpy(object, x, sizeof(double) * K);
        return true;
    }
    const uint32_t k = type == f.plain ? K - 1 : uint32_t(type - f.minimal0);
    for (uint32_t i = 0, j = 0; i < K; ++i) object[i] = i == k ? 1.0 : x[j++];
    return true;
}

int family_columns(const Family &f, int32_t type, uint32_t *cols)
{
    const int n = family_dim(f, type);
    if (n <= 0) return n;
    const uint32_t skip = type == f.full ? f.K : type == f.plain ? f.K - 1 : uint32_t(type - f.minimal0);
    for (uint32_t i = 0, j = 0; i < f.K; ++i)
        if (i != skip) cols[j++] = i;
    return n;
}

bool family_init(const Family &f, Sumo *sumo, SumoStateVector *s, const double *object, const char *function)
{
    if (object == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return false;
    }
    double x[16];
    return family_params(f, f.full, object, x, function) && init_state(sumo, s, f.full, x, f.K, f.scale, function);
}

bool family_init_fixed(const Family &f, Sumo *sumo, SumoStateVector *s, const double *object,
                       const char *function)
{
    SumoUserCopy copy = nullptr;
    switch (f.K) {
    case 3: copy = copy_bytes<3 * sizeof(double)>; break;
    case 4: copy = copy_bytes<4 * sizeof(double)>; break;
    default: copy = copy_bytes<9 * sizeof(double)>; break;
    }
    return init_fixed(sumo, s, f.fixed, object, sizeof(double) * f.K, copy, function);
}

bool family_init_minimal(const Family &f, Sumo *sumo, SumoStateVector *s, const double *object,
                         const char *function)
{
    if (object == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return false;
    }
    const int32_t type = f.minimal0 + int32_t(choose_fixed_entry(object, f.K));
    double x[16];
    return family_params(f, type, object, x, function) && init_state(sumo, s, type, x, f.K - 1, nullptr, function);
}

bool family_reset(const Family &f, SumoStateVector *s, const double *object, const char *function)
{
    const int n = family_dim(f, s->x.type);
    if (n < 0) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", s->x.type);
        return false;
    }
    if (dim(s) != uint32_t(n)) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state dimension does not fit its type", dim(s));
        return false;
    }
    double x[16];
    if (!family_params(f, s->x.type, object, x, function)) return false;
    if (n > 0) std::memcpy(s->x.v.data, x, sizeof(double) * uint32_t(n));
    return true;
}

bool family_fill(const Family &f, Plx_Matrix *J, const double *d, uint32_t rows, double scale, int32_t type,
                 const char *function)
{
    uint32_t cols[16];
    const int n = family_columns(f, type, cols);
    if (n < 0) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
    return fill_columns(J, d, rows, f.K, cols, uint32_t(n), scale, function);
}

}  // namespace sumo_states
