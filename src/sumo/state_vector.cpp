// State vectors: making, initialising, moving, copying and removing the unknowns.
#include <cstdlib>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

SumoStateVector *new_state(Sumo *sumo, SumoBranch *branch, uint32_t n, Plx_MemoryStack *ms,
                           SumoStateVector *existing, bool after, const char *function)
{
    if (sumo == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    if (existing != nullptr && existing->branch != branch) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "state not in the branch", 0);
        return nullptr;
    }
    SumoStateVector *s = state_make(sumo, n, ms, function);
    if (s == nullptr) return nullptr;
    if (branch != nullptr) {
        if (existing == nullptr)
            branch_append(branch, s);
        else if (!after)
            branch_insert_before(branch, s, existing);
        else if (existing->next != nullptr)
            branch_insert_before(branch, s, existing->next);
        else
            branch_append(branch, s);
        sumo->indices_valid = 0;
    }
    return s;
}

// True when the branch lies inside the state's hanging branch (moving the state there would
// hang it from itself).
bool branch_below_state(const SumoBranch *b, const SumoStateVector *s)
{
    while (b != nullptr) {
        if (b->kind == SUMO_BRANCH_FROM_STATE) {
            auto *p = static_cast<const SumoStateVector *>(b->parent);
            if (p == s) return true;
            b = p->branch;
        } else if (b->kind == SUMO_BRANCH_FROM_BRANCH) {
            b = static_cast<const SumoBranch *>(b->parent);
        } else {
            return false;
        }
    }
    return false;
}

void free_user_data(SumoStateVector *s)
{
    if (s->x.user_free != nullptr && s->x.user_data != nullptr) s->x.user_free(s->x.user_data);
    s->x.user_data = nullptr;
    s->x.user_free = nullptr;
    s->x.user_copy = nullptr;
}

}  // namespace

extern "C" {

PLANO_API SumoStateVector *pSumoStateVectorNew(Sumo *sumo, SumoBranch *branch, uint32_t n, Plx_MemoryStack *ms,
                                               const ThreadHostInterface *host)
{
    (void)host;
    return new_state(sumo, branch, n, ms, nullptr, false, __func__);
}

PLANO_API SumoStateVector *pSumoStateVectorNewBefore(Sumo *sumo, SumoBranch *branch, uint32_t n,
                                                     Plx_MemoryStack *ms, SumoStateVector *existing,
                                                     const ThreadHostInterface *host)
{
    (void)host;
    if (existing == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    return new_state(sumo, branch, n, ms, existing, false, __func__);
}

PLANO_API SumoStateVector *pSumoStateVectorNewAfter(Sumo *sumo, SumoBranch *branch, uint32_t n,
                                                    Plx_MemoryStack *ms, SumoStateVector *existing,
                                                    const ThreadHostInterface *host)
{
    (void)host;
    if (existing == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    return new_state(sumo, branch, n, ms, existing, true, __func__);
}

PLANO_API Plx_Bool bSumoStateVectorInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector *x0)
{
    if (sumo == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (state->status == SUMO_STATE_ELIMINATED) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state is eliminated", 0);
        return PLX_FALSE;
    }
    if (x0 != nullptr && x0->rows != dim(state)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "parameter vector size", int64_t(x0->rows));
        return PLX_FALSE;
    }
    if (state->status == SUMO_STATE_ACTIVE) {
        // Keep the caller's user data: re-initialising changes the parameters, not the type.
        void *data = state->x.user_data;
        SumoUserFree f = state->x.user_free;
        SumoUserCopy c = state->x.user_copy;
        state->x.user_free = nullptr;
        state->x.user_data = nullptr;
        const bool ok = bSumoStateVectorUninit(sumo, state, nullptr) != 0;
        state->x.user_data = data;
        state->x.user_free = f;
        state->x.user_copy = c;
        if (!ok) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    const uint32_t n = dim(state);
    if (x0 != nullptr && n > 0) std::memcpy(state->x.v.data, x0->data, sizeof(double) * n);
    std::memset(state->A.data, 0, sizeof(double) * n * n);
    state->A.type = PLX_SQUMAT_SYMMETRIC;
    if (n > 0) std::memset(state->b.data, 0, sizeof(double) * n);
    state->covariance_valid = 0;
    state->status = SUMO_STATE_ACTIVE;
    sumo->indices_valid = 0;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoStateVectorUninit(Sumo *sumo, SumoStateVector *state, const ThreadHostInterface *host)
{
    (void)host;
    if (sumo == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (state->status == SUMO_STATE_UNINITIALISED) return PLX_TRUE;
    if (state->status == SUMO_STATE_ELIMINATED) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state is eliminated", 0);
        return PLX_FALSE;
    }
    free_user_data(state);
    drop_state_blocks(state);
    state->covariance_valid = 0;
    state->adjust_func = nullptr;
    state->status = SUMO_STATE_UNINITIALISED;
    sumo->indices_valid = 0;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoStateVectorInitClone(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                             SumoStateVector *source, const ThreadHostInterface *host)
{
    if (sumo == nullptr || workspace == nullptr || state == nullptr || source == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (state == source || state->status == SUMO_STATE_ELIMINATED) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state cannot clone itself or be eliminated", 0);
        return PLX_FALSE;
    }
    while (state->obs_active != nullptr)
        if (!bSumoObsDelete(sumo, workspace, state->obs_active, host)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    while (state->obs_eliminated != nullptr)
        if (!bSumoObsDelete(sumo, workspace, state->obs_eliminated, host)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    if (state->status == SUMO_STATE_ACTIVE && !bSumoStateVectorUninit(sumo, state, host)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    free_user_data(state);
    if (dim(state) > 0) std::memset(state->x.v.data, 0, sizeof(double) * dim(state));
    if (!bSumoStateVectorInit(sumo, state, nullptr)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    state->x.type = SUMO_TYPE_CLONE;
    state->x.user_data = source->x.type == SUMO_TYPE_CLONE ? source->x.user_data : source;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoStateVectorMoveBranch(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                              SumoBranch *target)
{
    if (sumo == nullptr || workspace == nullptr || state == nullptr || target == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (state->status == SUMO_STATE_ELIMINATED || state->branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state is not in a branch", 0);
        return PLX_FALSE;
    }
    if (state->branch == target && target->last == state) return PLX_TRUE;
    if (branch_below_state(target, state)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "target hangs from the state", 0);
        return PLX_FALSE;
    }
    branch_cut(state);
    branch_append(target, state);
    sumo->indices_valid = 0;
    if (!ensure_indices(sumo) || !fix_block_orientation(sumo, workspace)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API SumoStateVector *pSumoStateVectorCopy(const SumoStateVector *source, Sumo *sumo, SumoBranch *branch,
                                                Plx_MemoryStack *ms, const ThreadHostInterface *host)
{
    if (source == nullptr || sumo == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    const uint32_t n = dim(source);
    SumoStateVector *s = new_state(sumo, branch, n, ms, nullptr, false, __func__);
    if (s == nullptr) return nullptr;
    bool ok = bSumoVectorCopy(&source->x, &s->x) != 0;
    if (ok) {
        std::memcpy(s->A.data, source->A.data, sizeof(double) * n * n);
        if (n > 0) std::memcpy(s->b.data, source->b.data, sizeof(double) * n);
        s->status = source->status == SUMO_STATE_ELIMINATED ? SUMO_STATE_ACTIVE : source->status;
        s->io_tag = source->io_tag;
        s->jacobian_step = source->jacobian_step;
        s->adjust_func = source->adjust_func;
        if (source->sub_branch != nullptr) {
            SumoBranch *b = pSumoBranchNewFromState(sumo, s);
            ok = b != nullptr && bSumoBranchCopy(sumo, b, source->sub_branch, ms, host);
        }
    }
    if (!ok) {
        PLX_ERR_PASS();
        branch_cut(s);
        vSumoStateVectorFree(sumo, s, host);
        return nullptr;
    }
    return s;
}

PLANO_API void vSumoStateVectorSetAdjustFunc(SumoStateVector *state, SumoAdjustFunction func)
{
    if (state != nullptr) state->adjust_func = func;
}

PLANO_API uint32_t uiSumoStateVectorObsListSize(const SumoStateVector *state)
{
    if (state == nullptr) return 0;
    uint32_t n = 0;
    for (const SumoObs *o = state->obs_active; o != nullptr; o = o->next_in_state[slot_of(o, state)]) ++n;
    return n;
}

PLANO_API void vSumoStateVectorFree(Sumo *sumo, SumoStateVector *state, const ThreadHostInterface *host)
{
    if (state == nullptr) return;
    if (state->sub_branch != nullptr) vSumoBranchFree(sumo, state->sub_branch, host);
    state->sub_branch = nullptr;
    if (state->user_list != nullptr) plx_list_free(state->user_list, std::free);
    state->user_list = nullptr;
    plx_list_free(&state->elim_blocks, nullptr);
    if (state->thread_blocks != nullptr) {
        const uint32_t T = sumo != nullptr ? sumo->n_threads : 0;
        for (uint32_t t = 0; t < T; ++t) {
            plx_squmat_free(&state->thread_blocks[t].A);
            plx_vec_free(&state->thread_blocks[t].b);
        }
        if (state->owned) std::free(state->thread_blocks);
        state->thread_blocks = nullptr;
    }
    vSumoVectorFree(&state->x);
    plx_vec_free(&state->x_old);
    plx_squmat_free(&state->A);
    plx_squmat_free(&state->A_work);
    plx_vec_free(&state->b);
    plx_vec_free(&state->b_work);
    plx_squmat_free(&state->covariance);
    vSumoOffdiagFreeRow(sumo, state->row_blocks);
    state->row_blocks = nullptr;
    if (state->owned) std::free(state);
}

PLANO_API void vSumoStateVectorListFree(Sumo *sumo, SumoStateVector *first, const ThreadHostInterface *host)
{
    for (SumoStateVector *s = first; s != nullptr;) {
        SumoStateVector *next = s->next;
        vSumoStateVectorFree(sumo, s, host);
        s = next;
    }
}

PLANO_API Plx_Bool bSumoStateDelete(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                    const ThreadHostInterface *host)
{
    (void)workspace;
    if (sumo == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    // Eliminated observations still refer to the state, so they block its removal too.
    if (state->obs_active != nullptr || state->obs_eliminated != nullptr || state->sub_branch != nullptr ||
        state->status == SUMO_STATE_ELIMINATED ||
        (dim(state) != 0 && state->status != SUMO_STATE_UNINITIALISED)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state still has observations, a branch or parameters", 0);
        return PLX_FALSE;
    }
    branch_cut(state);
    drop_state_blocks(state);
    vSumoStateVectorFree(sumo, state, host);
    sumo->indices_valid = 0;
    return PLX_TRUE;
}

PLANO_API SumoVector *psvSumoGetState(SumoStateVector *state) { return state != nullptr ? &state->x : nullptr; }
PLANO_API Plx_SquMatrix *pgsmSumoGetCovmatDiag(SumoStateVector *state)
{
    return state != nullptr ? &state->covariance : nullptr;
}
PLANO_API Plx_SquMatrix *pgsmSumoGetInfmatDiag(SumoStateVector *state) { return state != nullptr ? &state->A : nullptr; }

}  // extern "C"
