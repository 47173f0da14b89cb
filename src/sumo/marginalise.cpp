// Eliminating observations and states for good (marginalising them into a fixed prior),
// restoring them, and deleting observations.
//
// Eliminating a state E with neighbours C (information H = [A_E M; M^T A_C], vector b):
// the prior left to the neighbours is A_C - M^T A_E^-1 M with vector b_C - M^T A_E^-1 b_E.
// The vector part is applied by first moving E to its optimum given its neighbours
// (x_E += A_E^-1 b_E, which zeroes b_E and moves b_C by -M^T A_E^-1 b_E); from then on E
// follows its neighbours' increments through -A_E^-1 M (kept in the blocks' M_work).
#include <cstdlib>
#include <new>
#include <vector>

#include "sumo/fused_kernels.hpp"
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool has_state_with_status(const SumoObs *o, uint32_t status)
{
    for (uint32_t i = 0; i < o->n_states; ++i)
        if (o->states[i] != nullptr && o->states[i]->status == status) return true;
    return false;
}

bool store_copies(SumoObs *o)
{
    if (!o->store_states) return true;
    if (o->stored_states == nullptr) {
        o->stored_states = static_cast<Plx_Vector *>(alloc_zero(nullptr, sizeof(Plx_Vector) * o->n_states, "bSumoObsEliminate"));
        if (o->stored_states == nullptr) return false;
    }
    for (uint32_t i = 0; i < o->n_states; ++i) {
        const SumoStateVector *s = o->states[i];
        const uint32_t n = s != nullptr ? dim(s) : 0;
        if (!plx_vec_resize(&o->stored_states[i], n)) return false;
        if (n > 0) std::memcpy(o->stored_states[i].data, s->x.v.data, sizeof(double) * n);
    }
    return true;
}

bool list_contains(const Plx_List *list, const void *data)
{
    for (const Plx_ListNode *n = list->head; n != nullptr; n = n->next)
        if (n->data == data) return true;
    return false;
}

void list_remove(Plx_List *list, const void *data)
{
    for (list->current = list->head; list->current != nullptr; list->current = list->current->next)
        if (list->current->data == data) {
            plx_list_delete_current(list, nullptr);
            return;
        }
}

void transpose_block(SumoOffdiag *k, uint32_t T)
{
    auto flip = [](Plx_Matrix *m) {
        const uint32_t r = m->rows, c = m->cols;
        if (r > 1 && c > 1) {
            // In place through a cycle-free copy: blocks are small, so a stack buffer serves.
            double tmp[256];
            double *buf = tmp;
            double *heap = nullptr;
            if (std::size_t(r) * c > 256) buf = heap = static_cast<double *>(std::malloc(sizeof(double) * r * c));
            if (buf == nullptr) return false;
            std::memcpy(buf, m->data, sizeof(double) * r * c);
            for (uint32_t i = 0; i < r; ++i)
                for (uint32_t j = 0; j < c; ++j) m->data[std::size_t(j) * r + i] = buf[std::size_t(i) * c + j];
            std::free(heap);
        }
        m->rows = c;
        m->cols = r;
        return true;
    };
    flip(&k->M);
    flip(&k->M_work);
    flip(&k->M_cov);
    for (uint32_t t = 0; t < T; ++t) flip(&k->thread_blocks[t]);
    std::swap(k->row, k->col);
}

// Adds (sign 1) or subtracts (-1) what eliminating E passed on to its neighbours: to each
// neighbour's A the product M^T A_E^-1 M, and to the block between two neighbours the
// cross product. `create` makes missing blocks between neighbours.
bool pass_on(Sumo *sumo, SumoStateVector *e, double sign, bool create)
{
    const uint32_t n = dim(e);
    for (SumoOffdiag *kc = e->row_blocks; kc != nullptr; kc = kc->row_next) {
        SumoStateVector *C = kc->col;
        const uint32_t dc = dim(C);
        // M_work holds L^-1 M here (sign -1) or A_E^-1 M (sign +1, with M on the left).
        if (sign < 0)
            add_atb(-1.0, kc->M_work.data, kc->M_work.data, n, dc, dc, C->A.data);
        else
            add_atb(1.0, kc->M.data, kc->M_work.data, n, dc, dc, C->A.data);
        for (SumoOffdiag *kd = kc->row_next; kd != nullptr; kd = kd->row_next) {
            SumoStateVector *D = kd->col;
            SumoOffdiag *blk;
            bool c_row;
            if (!block_between(sumo, C, D, create, &blk, &c_row)) return false;
            if (blk == nullptr) continue;
            const double *left_c = sign < 0 ? kc->M_work.data : kc->M.data;
            const double *left_d = sign < 0 ? kd->M_work.data : kd->M.data;
            if (c_row)
                add_atb(sign, left_c, kd->M_work.data, n, dc, dim(D), blk->M.data);
            else
                add_atb(sign, left_d, kc->M_work.data, n, dim(D), dc, blk->M.data);
        }
    }
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoObsEliminate(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs,
                                     const ThreadHostInterface *host)
{
    (void)host;
    if (sumo == nullptr || workspace == nullptr || obs == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (obs->eliminated) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "observation already eliminated", 0);
        return PLX_FALSE;
    }
    if (!obs_all_initialised(obs)) {
        PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "observation on an uninitialised state", 0);
        return PLX_FALSE;
    }
    if (!ensure_indices(sumo) || !store_copies(obs) ||
        !bSumoObsEvaluate(sumo, workspace, obs, 1, 1, 1, kAll, kAll, SUMO_NOT_IN_THREAD)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    obs_unlink_states(obs, false);
    obs_unlink_sumo(sumo, obs, false);
    obs_link_states(obs, true);
    obs_link_sumo(sumo, obs, true);
    obs->eliminated = 1;
    sumo->modified = 1;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoObsEliminateSelected(Sumo *sumo, SumoWorkspace *workspace, SumoObsPredicate predicate,
                                             void *context, const ThreadHostInterface *host)
{
    if (sumo == nullptr || workspace == nullptr || predicate == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    // The selection is made first, then eliminated in list order. Each elimination evaluates
    // its observation on its own; the fused kernels, the bulk of that work for image blocks,
    // run ahead over all jobs for the selected observations (eliminating one observation changes
    // no parameter, so their terms stay valid through the loop).
    std::vector<SumoObs *> selected;
    try {
        for (SumoObs *o = sumo->obs_active; o != nullptr; o = o->next)
            if (predicate(o, context)) selected.push_back(o);
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "selected observations", 0);
        return PLX_FALSE;
    }
    FusedAhead ahead;
    const AheadInUse in_use(sumo);
    if (!terms_ahead_of(sumo, selected, kAll, kAll, host, __func__, ahead)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    for (SumoObs *o : selected)
        if (!bSumoObsEliminate(sumo, workspace, o, host)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoObsRestore(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs, const ThreadHostInterface *host)
{
    (void)host;
    if (sumo == nullptr || workspace == nullptr || obs == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!obs->eliminated) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "observation is not eliminated", 0);
        return PLX_FALSE;
    }
    // Its information went into states that have since been eliminated or reset.
    if (has_state_with_status(obs, SUMO_STATE_ELIMINATED) || !obs_all_initialised(obs)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "a state of the observation is not active", 0);
        return PLX_FALSE;
    }
    if (!ensure_indices(sumo) || !bSumoObsEvaluate(sumo, workspace, obs, 1, 1, 0, kAll, kAll, SUMO_NOT_IN_THREAD)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    obs_unlink_states(obs, true);
    obs_unlink_sumo(sumo, obs, true);
    obs_link_states(obs, false);
    obs_link_sumo(sumo, obs, false);
    obs->eliminated = 0;
    sumo->modified = 1;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoObsDelete(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs, const ThreadHostInterface *host)
{
    (void)host;
    if (sumo == nullptr || workspace == nullptr || obs == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (obs->eliminated) {
        if (has_state_with_status(obs, SUMO_STATE_ELIMINATED)) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "its information has passed on to eliminated states", 0);
            return PLX_FALSE;
        }
        if (obs_all_initialised(obs) &&
            (!ensure_indices(sumo) || !bSumoObsEvaluate(sumo, workspace, obs, 1, 1, 0, kAll, kAll, SUMO_NOT_IN_THREAD))) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    obs_unlink_states(obs, obs->eliminated != 0);
    obs_unlink_sumo(sumo, obs, obs->eliminated != 0);
    vSumoObsFree(obs);
    sumo->modified = 1;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoStateEliminate(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                       uint32_t adjust_type, const ThreadHostInterface *host)
{
    if (sumo == nullptr || workspace == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (adjust_type > SUMO_ADJUST_FULL) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown adjustment type", adjust_type);
        return PLX_FALSE;
    }
    if (state->status != SUMO_STATE_ACTIVE) {
        PLX_ERR_START(state->status == SUMO_STATE_ELIMINATED ? PLX_ERROR_INCOMPATIBLE : PLX_ERROR_NOT_INITIALISED,
                      "state is not active", state->status);
        return PLX_FALSE;
    }
    if (state->sub_branch != nullptr &&
        !bSumoBranchEliminate(sumo, workspace, state->sub_branch, adjust_type, host)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    while (state->obs_active != nullptr)
        if (!bSumoObsEliminate(sumo, workspace, state->obs_active, host)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    if (!ensure_indices(sumo)) return PLX_FALSE;
    const uint32_t n = dim(state);
    double *L = state->A_work.data;
    std::memcpy(L, state->A.data, sizeof(double) * n * n);
    if (!chol(L, n)) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "information of the state is not positive definite", 0);
        return PLX_FALSE;
    }
    // The state must be the row of all its blocks.
    while (state->col_blocks != nullptr) {
        SumoOffdiag *k = state->col_blocks;
        unlink_col(k);
        unlink_row(k);
        transpose_block(k, sumo->n_threads);
        link_row_sorted(k);
        link_col_sorted(k);
    }
    if (adjust_type != SUMO_ADJUST_NONE && n > 0) {
        // Move to the conditional optimum so that b_E is zero (see the top of the file).
        double *delta = state->b_work.data;
        std::memcpy(delta, state->b.data, sizeof(double) * n);
        fwd_v(L, n, delta);
        bwd_v(L, n, delta);
        add_into(state->x.v.data, delta, n);
        for (SumoOffdiag *k = state->row_blocks; k != nullptr; k = k->row_next)
            add_atv(-1.0, k->M.data, delta, n, dim(k->col), k->col->b.data);
        std::memset(state->b.data, 0, sizeof(double) * n);
        if (state->adjust_func != nullptr && !state->adjust_func(sumo, 0, state)) {
            PLX_ERR_START(PLX_ERROR_CALLEE, "adjust function failed", 0);
            return PLX_FALSE;
        }
        // States eliminated before this one follow its move.
        if (sumo->elim_last != nullptr) {
            zero_eliminated_increments(sumo);
            push_increment(state, delta);
            if (!cascade_eliminated(sumo)) {
                PLX_ERR_PASS();
                return PLX_FALSE;
            }
        }
    }
    for (SumoOffdiag *k = state->row_blocks; k != nullptr; k = k->row_next) {
        std::memcpy(k->M_work.data, k->M.data, sizeof(double) * n * k->M.cols);
        fwd_m(L, n, k->M_work.data, k->M.cols);
    }
    if (adjust_type != SUMO_ADJUST_NONE && !pass_on(sumo, state, -1.0, adjust_type == SUMO_ADJUST_FULL)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    for (SumoOffdiag *k = state->row_blocks; k != nullptr; k = k->row_next) bwd_m(L, n, k->M_work.data, k->M.cols);
    chol_inverse(L, n, state->covariance.data);
    std::memcpy(state->A_work.data, state->covariance.data, sizeof(double) * n * n);
    state->A_work.type = PLX_SQUMAT_SYMMETRIC;
    state->covariance_valid = 0;
    for (SumoOffdiag *k = state->row_blocks; k != nullptr; k = k->row_next) {
        unlink_col(k);
        if (!plx_list_insert_first(&k->col->elim_blocks, k)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    branch_cut(state);
    state->index = sumo->elim_last != nullptr ? sumo->elim_last->index + 1 : 0;
    state->prev = nullptr;
    state->next = sumo->elim_last;
    if (sumo->elim_last != nullptr)
        sumo->elim_last->prev = state;
    else
        sumo->elim_first = state;
    sumo->elim_last = state;
    state->status = SUMO_STATE_ELIMINATED;
    sumo->indices_valid = 0;
    sumo->modified = 1;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoStateRestore(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                     SumoBranch *target, uint32_t adjust_type, const ThreadHostInterface *host)
{
    (void)host;
    if (sumo == nullptr || workspace == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (state->status == SUMO_STATE_ACTIVE) return PLX_TRUE;
    if (target == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null target branch", 0);
        return PLX_FALSE;
    }
    if (adjust_type > SUMO_ADJUST_FULL) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown adjustment type", adjust_type);
        return PLX_FALSE;
    }
    bool listed = false;
    for (SumoStateVector *e = sumo->elim_last; e != nullptr && !listed; e = e->next) listed = e == state;
    if (!listed || state->status != SUMO_STATE_ELIMINATED) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state is not eliminated in this model", 0);
        return PLX_FALSE;
    }
    // A neighbour eliminated since has passed this state's prior on further: undoing that
    // is not possible here, so it must be restored first.
    for (SumoOffdiag *k = state->row_blocks; k != nullptr; k = k->row_next)
        if (!is_active(k->col) || !list_contains(&k->col->elim_blocks, k)) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "a neighbour of the state is no longer active", 0);
            return PLX_FALSE;
        }
    if (!ensure_indices(sumo)) return PLX_FALSE;
    if (adjust_type != SUMO_ADJUST_NONE && !pass_on(sumo, state, 1.0, adjust_type == SUMO_ADJUST_FULL)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    for (SumoStateVector *e = sumo->elim_last; e != state; e = e->next) --e->index;
    if (state->prev != nullptr)
        state->prev->next = state->next;
    else
        sumo->elim_last = state->next;
    if (state->next != nullptr)
        state->next->prev = state->prev;
    else
        sumo->elim_first = state->prev;
    state->prev = state->next = nullptr;
    for (SumoOffdiag *k = state->row_blocks; k != nullptr; k = k->row_next) {
        list_remove(&k->col->elim_blocks, k);
        k->col_prev = k->col_next = nullptr;
        link_col_sorted(k);
    }
    state->status = SUMO_STATE_ACTIVE;
    state->covariance_valid = 0;
    state->A_work.type = PLX_SQUMAT_SYMMETRIC;
    branch_append(target, state);
    sumo->indices_valid = 0;
    sumo->modified = 1;
    if (!ensure_indices(sumo) || !fix_block_orientation(sumo, workspace)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

}  // extern "C"
