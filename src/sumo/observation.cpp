// Observations: making them (with the states as an array or as arguments), overwriting,
// robustifying, walking a state's list, and freeing.
#include <cstdarg>
#include <cstdlib>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool is_h_kind(uint32_t kind) { return kind == SUMO_OBS_H || kind == SUMO_OBS_H_ROBUST; }

SumoObs *make_obs(Sumo *sumo, uint32_t kind, const Plx_Vector *z, const Plx_SquMatrix *N, SumoObsFunction func,
                  double s, double c, Plx_MemoryStack *ms, SumoStateVector **states, uint32_t n_states,
                  const char *function)
{
    if (sumo == nullptr || z == nullptr || N == nullptr || func.h == nullptr || (states == nullptr && n_states > 0)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    const uint32_t m = z->rows;
    if (N->size != m) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "matrix size differs from z", int64_t(N->size));
        return nullptr;
    }
    const bool robust = kind == SUMO_OBS_H_ROBUST || kind == SUMO_OBS_F_ROBUST;
    if (robust && !(s > 0.0 && c >= 0.0)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "variance scaling must be positive", 0);
        return nullptr;
    }
    for (uint32_t i = 0; i < n_states; ++i) {
        if (states[i] == nullptr) continue;
        if (states[i]->status == SUMO_STATE_ELIMINATED) {
            PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "observation on an eliminated state", i);
            return nullptr;
        }
        for (uint32_t j = 0; j < i; ++j)
            if (states[j] == states[i]) {
                PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "state listed twice", i);
                return nullptr;
            }
    }
    // One piece for the record and its three arrays.
    const std::size_t bytes = sizeof(SumoObs) + 3 * sizeof(void *) * n_states;
    auto *o = static_cast<SumoObs *>(alloc_zero(ms, bytes, function));
    if (o == nullptr) return nullptr;
    o->owned = ms == nullptr ? 1u : 0u;
    auto **arrays = reinterpret_cast<void **>(o + 1);
    o->states = reinterpret_cast<SumoStateVector **>(arrays);
    o->prev_in_state = reinterpret_cast<SumoObs **>(arrays + n_states);
    o->next_in_state = reinterpret_cast<SumoObs **>(arrays + 2 * std::size_t(n_states));
    for (uint32_t i = 0; i < n_states; ++i) o->states[i] = states[i];
    o->n_states = n_states;
    o->kind = kind;
    o->func = func;
    o->weight = 1.0;
    const std::size_t stored = N->type == PLX_SQUMAT_DIAGONAL ? m
                               : N->type == PLX_SQUMAT_SCALED_IDENTITY ? 1
                                                                       : std::size_t(m) * m;
    double *ndata = ms != nullptr ? static_cast<double *>(alloc_zero(ms, sizeof(double) * stored, function)) : nullptr;
    const bool ok = pSumoVectorForm(&o->z, m, ms) != nullptr &&
                    (ms != nullptr ? (ndata != nullptr && plx_squmat_form_data(&o->N, N->type, m, ndata) != nullptr)
                                   : plx_squmat_form(&o->N, N->type, m) != nullptr);
    if (!ok) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        vSumoObsFree(o);
        return nullptr;
    }
    if (m > 0) std::memcpy(o->z.v.data, z->data, sizeof(double) * m);
    std::memcpy(o->N.data, N->data, sizeof(double) * stored);
    if (robust) {
        o->variance_scaling = s;
        o->chi2_cutoff = c;
        o->chi2_offset = (1.0 - 1.0 / s) * c;
    }
    obs_link_sumo(sumo, o, false);
    obs_link_states(o, false);
    sumo->modified = 1;
    return o;
}

// Collects the states given as arguments up to a null.
template <class Make>
SumoObs *with_va_states(va_list args, Make &&make, const char *function)
{
    SumoStateVector *local[64];
    uint32_t n = 0;
    va_list count;
    va_copy(count, args);
    while (va_arg(count, SumoStateVector *) != nullptr) ++n;
    va_end(count);
    plx::HeapPtr<SumoStateVector *> heap;
    SumoStateVector **st = local;
    if (n > 64) {
        heap.reset(plx::heap_alloc<SumoStateVector *>(n, function, __FILE__, __LINE__));
        if (!heap) return nullptr;
        st = heap.get();
    }
    for (uint32_t i = 0; i < n; ++i) st[i] = va_arg(args, SumoStateVector *);
    return make(st, n);
}

bool overwrite(Sumo *sumo, SumoObs *obs, const Plx_Vector *z, const Plx_SquMatrix *N, bool h_family,
               const char *function)
{
    if (sumo == nullptr || obs == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return false;
    }
    if (is_h_kind(obs->kind) != h_family || obs->kind > SUMO_OBS_F_ROBUST) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "observation of the other family", obs->kind);
        return false;
    }
    const uint32_t m = obs->z.v.rows;
    if ((z != nullptr && z->rows != m) || (N != nullptr && N->size != m)) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "size differs from the observation", m);
        return false;
    }
    if (N != nullptr) {
        if (!plx_squmat_resize(&obs->N, N->type, m) || !plx_squmat_copy(N, &obs->N)) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return false;
        }
    }
    if (z != nullptr && m > 0) std::memcpy(obs->z.v.data, z->data, sizeof(double) * m);
    obs->weight = 1.0;
    sumo->modified = 1;
    return true;
}

}  // namespace

extern "C" {

PLANO_API SumoObs *pSumoObsH(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni, SumoHFunction h,
                             Plx_MemoryStack *ms, SumoStateVector **states, uint32_t n_states)
{
    SumoObsFunction f;
    f.h = h;
    return make_obs(sumo, SUMO_OBS_H, z, Ni, f, 0.0, 0.0, ms, states, n_states, __func__);
}

PLANO_API SumoObs *pSumoObsHRobust(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni, SumoHFunction h,
                                   double s, double c, Plx_MemoryStack *ms, SumoStateVector **states,
                                   uint32_t n_states)
{
    SumoObsFunction f;
    f.h = h;
    return make_obs(sumo, SUMO_OBS_H_ROBUST, z, Ni, f, s, c, ms, states, n_states, __func__);
}

PLANO_API SumoObs *pSumoObsF(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N, SumoFFunction F,
                             Plx_MemoryStack *ms, SumoStateVector **states, uint32_t n_states)
{
    SumoObsFunction f;
    f.F = F;
    return make_obs(sumo, SUMO_OBS_F, z, N, f, 0.0, 0.0, ms, states, n_states, __func__);
}

PLANO_API SumoObs *pSumoObsFRobust(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N, SumoFFunction F,
                                   double s, double c, Plx_MemoryStack *ms, SumoStateVector **states,
                                   uint32_t n_states)
{
    SumoObsFunction f;
    f.F = F;
    return make_obs(sumo, SUMO_OBS_F_ROBUST, z, N, f, s, c, ms, states, n_states, __func__);
}

PLANO_API SumoObs *pSumoObsH_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni, SumoHFunction h,
                                Plx_MemoryStack *ms, ...)
{
    va_list args;
    va_start(args, ms);
    SumoObs *o = with_va_states(
        args,
        [&](SumoStateVector **st, uint32_t n) {
            SumoObsFunction f;
            f.h = h;
            return make_obs(sumo, SUMO_OBS_H, z, Ni, f, 0.0, 0.0, ms, st, n, "pSumoObsH_va");
        },
        __func__);
    va_end(args);
    return o;
}

PLANO_API SumoObs *pSumoObsHRobust_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *Ni,
                                      SumoHFunction h, double s, double c, Plx_MemoryStack *ms, ...)
{
    va_list args;
    va_start(args, ms);
    SumoObs *o = with_va_states(
        args,
        [&](SumoStateVector **st, uint32_t n) {
            SumoObsFunction f;
            f.h = h;
            return make_obs(sumo, SUMO_OBS_H_ROBUST, z, Ni, f, s, c, ms, st, n, "pSumoObsHRobust_va");
        },
        __func__);
    va_end(args);
    return o;
}

PLANO_API SumoObs *pSumoObsF_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N, SumoFFunction F,
                                Plx_MemoryStack *ms, ...)
{
    va_list args;
    va_start(args, ms);
    SumoObs *o = with_va_states(
        args,
        [&](SumoStateVector **st, uint32_t n) {
            SumoObsFunction f;
            f.F = F;
            return make_obs(sumo, SUMO_OBS_F, z, N, f, 0.0, 0.0, ms, st, n, "pSumoObsF_va");
        },
        __func__);
    va_end(args);
    return o;
}

PLANO_API SumoObs *pSumoObsFRobust_va(Sumo *sumo, const Plx_Vector *z, const Plx_SquMatrix *N,
                                      SumoFFunction F, double s, double c, Plx_MemoryStack *ms, ...)
{
    va_list args;
    va_start(args, ms);
    SumoObs *o = with_va_states(
        args,
        [&](SumoStateVector **st, uint32_t n) {
            SumoObsFunction f;
            f.F = F;
            return make_obs(sumo, SUMO_OBS_F_ROBUST, z, N, f, s, c, ms, st, n, "pSumoObsFRobust_va");
        },
        __func__);
    va_end(args);
    return o;
}

PLANO_API Plx_Bool bSumoObsH_Overwrite(Sumo *sumo, SumoObs *obs, const Plx_Vector *z, const Plx_SquMatrix *Ni)
{
    return overwrite(sumo, obs, z, Ni, true, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoObsF_Overwrite(Sumo *sumo, SumoObs *obs, const Plx_Vector *z, const Plx_SquMatrix *N)
{
    return overwrite(sumo, obs, z, N, false, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoObs_Robustify(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs, double s, double c)
{
    if (sumo == nullptr || workspace == nullptr || obs == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (obs->kind > SUMO_OBS_F_ROBUST) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown observation kind", obs->kind);
        return PLX_FALSE;
    }
    if (!(s > 0.0 && c >= 0.0)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "variance scaling must be positive", 0);
        return PLX_FALSE;
    }
    // Robust kinds take the new parameters: robustifying twice re-tunes the test.
    const uint32_t old_kind = obs->kind;
    const double old_s = obs->variance_scaling, old_c = obs->chi2_cutoff, old_off = obs->chi2_offset;
    obs->kind = is_h_kind(obs->kind) ? SUMO_OBS_H_ROBUST : SUMO_OBS_F_ROBUST;
    obs->variance_scaling = s;
    obs->chi2_cutoff = c;
    obs->chi2_offset = (1.0 - 1.0 / s) * c;
    sumo->modified = 1;
    if (!obs_all_initialised(obs)) {
        obs->outlier = 0;
        return PLX_TRUE;
    }
    if (obs_cost(sumo, workspace, obs, __func__) == SUMO_FAILED_RESIDUAL) {
        obs->kind = old_kind;
        obs->variance_scaling = old_s;
        obs->chi2_cutoff = old_c;
        obs->chi2_offset = old_off;
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoObs_DeRobustify(Sumo *sumo, SumoObs *obs)
{
    if (sumo == nullptr || obs == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    switch (obs->kind) {
    case SUMO_OBS_H:
    case SUMO_OBS_F:
        return PLX_TRUE;
    case SUMO_OBS_H_ROBUST:
    case SUMO_OBS_F_ROBUST:
        obs->kind = obs->kind == SUMO_OBS_H_ROBUST ? SUMO_OBS_H : SUMO_OBS_F;
        obs->outlier = 0;
        sumo->modified = 1;
        return PLX_TRUE;
    default:
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown observation kind", obs->kind);
        return PLX_FALSE;
    }
}

PLANO_API SumoObs *pSumoObsGetNext(const SumoObs *obs, const SumoStateVector *state)
{
    if (obs == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    const int i = slot_of(obs, state);
    if (i < 0) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state is not one of the observation's", 0);
        return nullptr;
    }
    return obs->next_in_state[i];
}

PLANO_API SumoObs *pSumoObsGetPrev(const SumoObs *obs, const SumoStateVector *state)
{
    if (obs == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    const int i = slot_of(obs, state);
    if (i < 0) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state is not one of the observation's", 0);
        return nullptr;
    }
    return obs->prev_in_state[i];
}

PLANO_API Plx_Bool bSumoObsSwapStates(SumoObs *obs, uint32_t i, uint32_t j)
{
    if (obs == nullptr || i >= obs->n_states || j >= obs->n_states) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "slot outside the observation", 0);
        return PLX_FALSE;
    }
    std::swap(obs->states[i], obs->states[j]);
    std::swap(obs->prev_in_state[i], obs->prev_in_state[j]);
    std::swap(obs->next_in_state[i], obs->next_in_state[j]);
    return PLX_TRUE;
}

PLANO_API void vSumoObsFree(SumoObs *obs)
{
    if (obs == nullptr) return;
    if (obs->stored_states != nullptr) {
        for (uint32_t i = 0; i < obs->n_states; ++i) plx_vec_free(&obs->stored_states[i]);
        std::free(obs->stored_states);
        obs->stored_states = nullptr;
    }
    plx_squmat_free(&obs->N);
    vSumoVectorFree(&obs->z);
    if (obs->owned) std::free(obs);
}

PLANO_API void vSumoObsListFree(SumoObs *first)
{
    for (SumoObs *o = first; o != nullptr;) {
        SumoObs *next = o->next;
        vSumoObsFree(o);
        o = next;
    }
}

}  // extern "C"
