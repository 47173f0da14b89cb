// Building the information of a branch or a run of states: reset the work copies to the
// fixed prior, evaluate the observations (threaded through the host's pool), combine the
// per-thread accumulators, and damp the diagonal.
#include <vector>

#include "common/job_batch.hpp"
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool in_last(const SumoStateVector *s, uint32_t last) { return last == kAll || s->index <= last; }

// A chunk of the active list for the root build.
struct RootJob {
    Sumo *sumo;
    SumoWorkspace *ws;
    SumoObs *start;
    uint32_t count;
    uint32_t thread;
    uint32_t residual;
};

Plx_Bool root_job(void *argument)
{
    auto *job = static_cast<RootJob *>(argument);
    uint32_t done = 0;
    for (SumoObs *o = job->start; o != nullptr && done < job->count; o = o->next) {
        if (!obs_all_initialised(o)) continue;
        ++done;
        if (!bSumoObsEvaluate(job->sumo, job->ws, o, job->residual, 0, 1, kAll, kAll, job->thread)) return PLX_FALSE;
    }
    return PLX_TRUE;
}

// A sub-range of indices for a branch or run build.
struct RangeJob {
    Sumo *sumo;
    SumoWorkspace *ws;
    const Scope *scope;
    uint32_t residual;
    uint32_t first, last;
    uint32_t own_first, own_last;
    uint32_t thread;
};

Plx_Bool range_job(void *argument)
{
    auto *job = static_cast<RangeJob *>(argument);
    if (job->own_first > job->own_last) return PLX_TRUE;
    return evaluate_scope(job->sumo, job->ws, *job->scope, job->residual, job->first, job->last, job->own_first,
                          job->own_last, job->thread)
               ? PLX_TRUE
               : PLX_FALSE;
}

template <class Job>
bool run(const ThreadHostInterface *host, Plx_Bool (*fn)(void *), std::vector<Job> &jobs, const char *function)
{
    std::vector<ThreadedWorker *> workers(jobs.size(), nullptr);
    const plano::JobsResult r =
        plano::run_jobs(host, fn, jobs.data(), sizeof(Job), uint32_t(jobs.size()), workers.data());
    if (r != plano::JobsResult::ok) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, plano::jobs_failure_message(r), 0);
        return false;
    }
    return true;
}

bool build_root(Sumo *sumo, uint32_t residual, const ThreadHostInterface *host, const char *function)
{
    Scope all;
    all.branch = sumo->root;
    if (!reset_scope(all, kAll, sumo->n_threads)) return false;
    if (!create_blocks_scope(sumo, all, kAll, kAll)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    const uint32_t T = sumo->n_threads;
    SumoWorkspace *ws = job_workspaces(sumo, T == 0 ? 1 : T);
    if (ws == nullptr) return false;
    if (T == 0) {
        RootJob job{sumo, ws, sumo->obs_active, 0xFFFFFFFFu, SUMO_NOT_IN_THREAD, residual};
        if (!root_job(&job)) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return false;
        }
        return true;
    }
    uint64_t K = 0;
    for (SumoObs *o = sumo->obs_active; o != nullptr; o = o->next)
        if (obs_all_initialised(o)) ++K;
    std::vector<RootJob> jobs(T);
    // Chunk j holds the counted observations numbered [jK/T, (j+1)K/T).
    uint64_t counted = 0;
    uint32_t j = 0;
    SumoObs *o = sumo->obs_active;
    for (; j < T; ++j) {
        const uint64_t begin = K * j / T, end = K * (j + 1) / T;
        while (o != nullptr && (!obs_all_initialised(o) || counted < begin)) {
            if (obs_all_initialised(o)) ++counted;
            o = o->next;
        }
        jobs[j] = RootJob{sumo, &ws[j], o, uint32_t(end - begin), j, residual};
    }
    if (!run(host, root_job, jobs, function)) return false;
    return combine_scope(all, kAll, 0, T);
}

}  // namespace

namespace sumo {

bool reset_scope(const Scope &scope, uint32_t last, uint32_t n_threads)
{
    return scope.walk([&](SumoStateVector *s) {
        if (!is_active(s) || !in_last(s, last)) return true;
        const uint32_t n = dim(s);
        std::memcpy(s->A_work.data, s->A.data, sizeof(double) * n * n);
        s->A_work.type = PLX_SQUMAT_SYMMETRIC;
        if (n > 0) std::memcpy(s->b_work.data, s->b.data, sizeof(double) * n);
        for (uint32_t t = 0; t < n_threads; ++t) {
            std::memset(s->thread_blocks[t].A.data, 0, sizeof(double) * n * n);
            if (n > 0) std::memset(s->thread_blocks[t].b.data, 0, sizeof(double) * n);
        }
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            if (!in_last(k->col, last)) continue;
            const std::size_t count = std::size_t(k->M.rows) * k->M.cols;
            std::memcpy(k->M_work.data, k->M.data, sizeof(double) * count);
            for (uint32_t t = 0; t < n_threads; ++t) std::memset(k->thread_blocks[t].data, 0, sizeof(double) * count);
        }
        return true;
    });
}

bool combine_scope(const Scope &scope, uint32_t last, uint32_t into_fixed, uint32_t n_threads)
{
    return scope.walk([&](SumoStateVector *s) {
        if (!is_active(s) || !in_last(s, last)) return true;
        const uint32_t n = dim(s);
        double *A = into_fixed ? s->A.data : s->A_work.data;
        double *b = into_fixed ? s->b.data : s->b_work.data;
        for (uint32_t t = 0; t < n_threads; ++t) {
            add_into(A, s->thread_blocks[t].A.data, std::size_t(n) * n);
            add_into(b, s->thread_blocks[t].b.data, n);
        }
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            if (!in_last(k->col, last)) continue;
            double *M = into_fixed ? k->M.data : k->M_work.data;
            for (uint32_t t = 0; t < n_threads; ++t)
                add_into(M, k->thread_blocks[t].data, std::size_t(k->M.rows) * k->M.cols);
        }
        return true;
    });
}

bool evaluate_scope(Sumo *sumo, SumoWorkspace *ws, const Scope &scope, uint32_t residual, uint32_t first,
                    uint32_t last, uint32_t own_first, uint32_t own_last, uint32_t thread)
{
    return scope.walk([&](SumoStateVector *s) {
        if (!is_active(s) || s->index < own_first || s->index > own_last) return true;
        for (SumoObs *o = s->obs_active; o != nullptr; o = o->next_in_state[slot_of(o, s)]) {
            if (!obs_all_initialised(o) || !obs_lowest_in_range(o, s, first)) continue;
            if (!bSumoObsEvaluate(sumo, ws, o, residual, 0, 1, first, last, thread)) return false;
        }
        return true;
    });
}

bool build_scope(Sumo *sumo, const Scope &scope, uint32_t residual, uint32_t first, uint32_t last,
                 const ThreadHostInterface *host, const char *function)
{
    if (!ensure_indices(sumo)) return false;
    if (scope.branch == sumo->root && first == kAll) return build_root(sumo, residual, host, function);
    if (first == kAll) {
        if (scope.branch == nullptr) {
            if (last != kAll) {
                PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "first index unset but last index set", last);
                return false;
            }
            return reset_scope(scope, kAll, sumo->n_threads);
        }
        // A branch on its own: its own index limits.
        bSumoGetIndexLimitsBranch(scope.branch, &first, &last);
        if (first == kAll) return reset_scope(scope, kAll, sumo->n_threads);
    }
    if (last < first) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "last index before first", last);
        return false;
    }
    if (!reset_scope(scope, last, sumo->n_threads)) return false;
    if (!create_blocks_scope(sumo, scope, first, last)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    const uint32_t T = sumo->n_threads;
    if (host == nullptr || T == 0) {
        SumoWorkspace *ws = job_workspaces(sumo, 1);
        if (ws == nullptr || !evaluate_scope(sumo, ws, scope, residual, first, last, first, last, SUMO_NOT_IN_THREAD)) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return false;
        }
        return true;
    }
    SumoWorkspace *ws = job_workspaces(sumo, T);
    if (ws == nullptr) return false;
    const uint64_t L = uint64_t(last) - first + 1;
    std::vector<RangeJob> jobs(T);
    for (uint32_t j = 0; j < T; ++j) {
        const uint64_t lo = first + L * j / T, hi = first + L * (j + 1) / T;
        // An empty sub-range is marked by own_first > own_last.
        jobs[j] = RangeJob{sumo, &ws[j], &scope, residual, first, last, uint32_t(lo),
                           hi > lo ? uint32_t(hi - 1) : 0u, j};
        if (hi == lo) jobs[j].own_first = 1, jobs[j].own_last = 0;
    }
    if (!run(host, range_job, jobs, function)) return false;
    return combine_scope(scope, last, 0, T);
}

}  // namespace sumo

extern "C" {

PLANO_API Plx_Bool bSumoBuildInformationBlocksBranch(Sumo *sumo, SumoBranch *branch, uint32_t residual,
                                                     uint32_t first, uint32_t last, const ThreadHostInterface *host)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    Scope scope;
    scope.branch = branch;
    return build_scope(sumo, scope, residual, first, last, host, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoBuildInformationBlocksStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                         SumoStateVector *last_state, uint32_t first, uint32_t last,
                                                         const ThreadHostInterface *host)
{
    if (sumo == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!range_reachable(first_state, last_state, __func__)) return PLX_FALSE;
    Scope scope;
    scope.first = first_state;
    scope.last = last_state;
    return build_scope(sumo, scope, 1, first, last, host, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoEvaluateObsBranch(Sumo *sumo, SumoBranch *branch, uint32_t first, uint32_t last,
                                          const ThreadHostInterface *host)
{
    (void)host;
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!ensure_indices(sumo)) return PLX_FALSE;
    Scope scope;
    scope.branch = branch;
    SumoWorkspace *ws = job_workspaces(sumo, 1);
    const uint32_t own_last = first == kAll ? kAll : last;
    if (ws == nullptr || !create_blocks_scope(sumo, scope, first, last) ||
        !evaluate_scope(sumo, ws, scope, 1, first, last, first == kAll ? 0 : first, own_last, SUMO_NOT_IN_THREAD)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoEvaluateObsStateRange(Sumo *sumo, SumoStateVector *first_state, SumoStateVector *last_state,
                                              uint32_t first, uint32_t last, const ThreadHostInterface *host)
{
    (void)host;
    if (sumo == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!range_reachable(first_state, last_state, __func__) || !ensure_indices(sumo)) return PLX_FALSE;
    Scope scope;
    scope.first = first_state;
    scope.last = last_state;
    SumoWorkspace *ws = job_workspaces(sumo, 1);
    const uint32_t own_last = first == kAll ? kAll : last;
    if (ws == nullptr ||
        !evaluate_scope(sumo, ws, scope, 1, first, last, first == kAll ? 0 : first, own_last, SUMO_NOT_IN_THREAD)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoResetInfoBranch(Sumo *sumo, SumoBranch *branch, uint32_t last)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!ensure_indices(sumo)) return PLX_FALSE;
    Scope scope;
    scope.branch = branch;
    return reset_scope(scope, last, sumo->n_threads) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoResetInfoStateRange(Sumo *sumo, SumoStateVector *first_state, SumoStateVector *last_state,
                                            uint32_t last)
{
    if (sumo == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!range_reachable(first_state, last_state, __func__) || !ensure_indices(sumo)) return PLX_FALSE;
    Scope scope;
    scope.first = first_state;
    scope.last = last_state;
    return reset_scope(scope, last, sumo->n_threads) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoCombineThreadedInfoBranch(Sumo *sumo, SumoBranch *branch, uint32_t last, uint32_t into_fixed)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    Scope scope;
    scope.branch = branch;
    return combine_scope(scope, last, into_fixed, sumo->n_threads) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoCombineThreadedInfoStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                      SumoStateVector *last_state, uint32_t last, uint32_t into_fixed)
{
    if (sumo == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!range_reachable(first_state, last_state, __func__)) return PLX_FALSE;
    Scope scope;
    scope.first = first_state;
    scope.last = last_state;
    return combine_scope(scope, last, into_fixed, sumo->n_threads) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bDampInformationMatrixState(SumoStateVector *state, double lambda, uint32_t mode)
{
    if (state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!is_active(state)) return PLX_TRUE;
    const uint32_t n = dim(state);
    for (uint32_t i = n; i-- > 0;) {
        double &a = state->A_work.data[std::size_t(i) * n + i];
        a = mode == SUMO_DAMP_MULTIPLICATIVE ? a * (1.0 + lambda) : a + lambda;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bDampInformationMatrixBranch(SumoBranch *branch, double lambda, uint32_t mode)
{
    if (branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    Scope scope;
    scope.branch = branch;
    return scope.walk([&](SumoStateVector *s) { return bDampInformationMatrixState(s, lambda, mode) != 0; })
               ? PLX_TRUE
               : PLX_FALSE;
}

PLANO_API Plx_Bool bDampInformationMatrixStateRange(SumoStateVector *first_state, SumoStateVector *last_state,
                                                    double lambda, uint32_t mode)
{
    if (!range_reachable(first_state, last_state, __func__)) return PLX_FALSE;
    Scope scope;
    scope.first = first_state;
    scope.last = last_state;
    return scope.walk([&](SumoStateVector *s) { return bDampInformationMatrixState(s, lambda, mode) != 0; })
               ? PLX_TRUE
               : PLX_FALSE;
}

}  // extern "C"
