// Applying a solved step: increments, stored and reinstated parameters, moving the fixed
// prior to the new linearisation point, and carrying eliminated states along.
#include <vector>

#include "common/job_batch.hpp"
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool in_range(const SumoStateVector *s, uint32_t first, uint32_t last)
{
    return is_active(s) && (first == kAll || s->index >= first) && (last == kAll || s->index <= last);
}

bool call_adjust(Sumo *sumo, SumoStateVector *s, uint32_t mode, const char *function)
{
    if (s->adjust_func == nullptr || s->adjust_func(sumo, mode, s)) return true;
    plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "adjust function failed", mode);
    return false;
}

struct StoreJob {
    const Scope *scope;
    uint32_t j, T;
};

Plx_Bool store_job(void *argument)
{
    auto *job = static_cast<StoreJob *>(argument);
    job->scope->walk([&](SumoStateVector *s) {
        if (is_active(s) && s->index % job->T == job->j && dim(s) > 0)
            std::memcpy(s->x_old.data, s->x.v.data, sizeof(double) * dim(s));
        return true;
    });
    return PLX_TRUE;
}

}  // namespace

namespace sumo {

bool increment_scope(Sumo *sumo, const Scope &scope, uint32_t first, uint32_t last)
{
    return scope.walk([&](SumoStateVector *s) {
        if (!in_range(s, first, last)) return true;
        add_into(s->x.v.data, s->b_work.data, dim(s));
        return call_adjust(sumo, s, 0, "bIncrementParameters");
    });
}

bool store_scope(const Scope &scope, const ThreadHostInterface *host)
{
    const uint32_t T = host != nullptr ? plano::job_count(host) : 1;
    uint64_t states = 0;
    if (T > 1)
        scope.walk([&](SumoStateVector *s) {
            states += is_active(s) ? 1 : 0;
            return true;
        });
    host = host_for(host, states, kMinStatesPerJob, T);
    std::vector<StoreJob> jobs(T);
    for (uint32_t j = 0; j < T; ++j) jobs[j] = StoreJob{&scope, j, T};
    std::vector<ThreadedWorker *> workers(T, nullptr);
    const plano::JobsResult r = plano::run_jobs(host, store_job, jobs.data(), sizeof(StoreJob), T, workers.data());
    if (r != plano::JobsResult::ok) {
        plx_err_register_fileline("bSumoStoreParameters", PLX_ERROR_CALLEE, __FILE__, __LINE__,
                                  plano::jobs_failure_message(r), 0);
        return false;
    }
    return true;
}

bool reinstate_scope(Sumo *sumo, const Scope &scope)
{
    return scope.walk([&](SumoStateVector *s) {
        if (!is_active(s)) return true;
        if (dim(s) > 0) std::memcpy(s->x.v.data, s->x_old.data, sizeof(double) * dim(s));
        return call_adjust(sumo, s, 1, "bSumoReinstateOldParameters");
    });
}

bool adjust_info_vector_scope(const Scope &scope, uint32_t first, uint32_t last)
{
    return scope.walk([&](SumoStateVector *s) {
        if (!in_range(s, first, last)) return true;
        const uint32_t n = dim(s);
        double *b = s->b.data;
        add_av(-1.0, s->A.data, s->b_work.data, n, n, b);
        for (SumoOffdiag *k = s->col_blocks; k != nullptr; k = k->col_next)
            if (in_range(k->row, first, last)) add_atv(-1.0, k->M.data, k->row->b_work.data, dim(k->row), n, b);
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next)
            if (in_range(k->col, first, last)) add_av(-1.0, k->M.data, k->col->b_work.data, n, dim(k->col), b);
        return true;
    });
}

// Eliminated states follow the active ones along the linearisation kept at their
// elimination: delta_E = -A_E^-1 M_E delta_neighbours, propagated from the newest
// eliminated state to the oldest (each one's increment held in its b_work).
void zero_eliminated_increments(Sumo *sumo)
{
    for (SumoStateVector *e = sumo->elim_last; e != nullptr; e = e->next) {
        if (e->next != nullptr) __builtin_prefetch(e->next->next);
        if (dim(e) > 0) std::memset(e->b_work.data, 0, sizeof(double) * dim(e));
    }
}

// Pushes a state's increment to the eliminated states linked to it (their b_work).
void push_increment(const SumoStateVector *s, const double *delta)
{
    for (Plx_ListNode *n = s->elim_blocks.head; n != nullptr; n = n->next) {
        auto *k = static_cast<SumoOffdiag *>(n->data);
        add_av(-1.0, k->M_work.data, delta, dim(k->row), dim(s), k->row->b_work.data);
    }
}

bool cascade_eliminated(Sumo *sumo)
{
    // Covariances are cleared on the way: the adjust functions see only parameters.
    for (SumoStateVector *e = sumo->elim_last; e != nullptr; e = e->next) {
        prefetch_eliminated(e);
        add_into(e->x.v.data, e->b_work.data, dim(e));
        e->covariance_valid = 0;
        if (!call_adjust(sumo, e, 0, "bAdjustEliminatedStates")) {
            for (SumoStateVector *rest = e->next; rest != nullptr; rest = rest->next) rest->covariance_valid = 0;
            return false;
        }
        push_increment(e, e->b_work.data);
    }
    return true;
}

bool adjust_eliminated_states_in(Sumo *sumo, uint32_t first, uint32_t last)
{
    if (sumo->elim_last == nullptr) return true;
    zero_eliminated_increments(sumo);
    auto from_active = [&](SumoStateVector *s) {
        if (in_range(s, first, last)) push_increment(s, s->b_work.data);
        return true;
    };
    walk_branch(sumo->root, from_active);
    return cascade_eliminated(sumo);
}

bool adjust_eliminated_states(Sumo *sumo) { return adjust_eliminated_states_in(sumo, kAll, kAll); }

}  // namespace sumo

extern "C" {

PLANO_API Plx_Bool bIncrementParametersBranch(Sumo *sumo, SumoBranch *branch)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    return increment_scope(sumo, Scope::of(branch), kAll, kAll) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bIncrementParametersStateRange(Sumo *sumo, SumoStateVector *first_state, SumoStateVector *last_state)
{
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return PLX_FALSE;
    return increment_scope(sumo, scope, kAll, kAll) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoStoreParametersBranch(SumoBranch *branch, const ThreadHostInterface *host)
{
    if (branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    return store_scope(Scope::of(branch), host) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoStoreParametersStateRange(SumoStateVector *first_state, SumoStateVector *last_state,
                                                  const ThreadHostInterface *host)
{
    Scope scope;
    if (!open_run(first_state, last_state, __func__, &scope)) return PLX_FALSE;
    return store_scope(scope, host) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoReinstateOldParametersBranch(Sumo *sumo, SumoBranch *branch)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    return reinstate_scope(sumo, Scope::of(branch)) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoReinstateOldParametersStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                         SumoStateVector *last_state)
{
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return PLX_FALSE;
    return reinstate_scope(sumo, scope) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoReinstateOldParametersState(Sumo *sumo, SumoStateVector *state)
{
    if (sumo == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!is_active(state)) return PLX_TRUE;
    if (dim(state) > 0) std::memcpy(state->x.v.data, state->x_old.data, sizeof(double) * dim(state));
    return call_adjust(sumo, state, 1, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bAdjustInformationVectorBranch(Sumo *sumo, SumoBranch *branch, uint32_t first, uint32_t last)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    return adjust_info_vector_scope(Scope::of(branch), first, last) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bAdjustInformationVectorStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                      SumoStateVector *last_state, uint32_t first, uint32_t last)
{
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return PLX_FALSE;
    return adjust_info_vector_scope(scope, first, last) ? PLX_TRUE : PLX_FALSE;
}

}  // extern "C"
