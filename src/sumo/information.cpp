// Building the information of a branch or a run of states: reset the work copies to the
// fixed prior, evaluate the observations (threaded through the host's pool), combine the
// per-thread accumulators, and damp the diagonal.
#include <algorithm>
#include <new>
#include <vector>

#include "common/job_batch.hpp"
#include "sumo/fused_kernels.hpp"
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool in_last(const SumoStateVector *s, uint32_t last) { return last == kAll || s->index <= last; }

// A run of whole cost chunks of the counted observations for the root build; with `cost`,
// each chunk's cost is summed as it goes (as the total cost sums it).
struct RootJob {
    Sumo *sumo;
    SumoWorkspace *ws;
    SumoObs *const *obs;  // all the counted observations
    uint32_t begin, end;  // the job's observations
    uint32_t thread;
    uint32_t residual;
    double *sums;         // with cost, one per chunk of the whole list; else null
};

Plx_Bool root_job(void *argument)
{
    auto *job = static_cast<RootJob *>(argument);
    for (uint32_t i = job->begin; i < job->end; ++i) {
        prefetch_obs(job->obs + job->begin, i - job->begin, job->end - job->begin);
        double c;
        if (!accumulate_obs(job->sumo, job->ws, job->obs[i], job->residual, 0, 1, kAll, kAll, job->thread, &c)) {
            plx_err_register_fileline("bSumoObsEvaluate", PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return PLX_FALSE;
        }
        if (job->sums != nullptr) job->sums[i / kCostChunk] += c;
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

bool threaded(const Sumo *sumo, const ThreadHostInterface *host) { return host != nullptr && sumo->n_threads > 0; }

// A slice of the observations whose fused terms are computed ahead.
struct AheadJob {
    FusedAhead *ahead;
    SumoObs *const *obs;
    uint32_t begin, end;
};

Plx_Bool ahead_job(void *argument)
{
    auto *job = static_cast<AheadJob *>(argument);
    FusedAhead &a = *job->ahead;
    for (uint32_t i = job->begin; i < job->end; ++i)
        a.done[i] = fused_terms_of(job->obs[i], a.first, a.last, &a.terms[i]) ? 1 : 0;
    return PLX_TRUE;
}

// One state may own nearly all the work: a tracked region's pixel blocks all belong to its
// illumination state, and the owner split would leave them to one job. Their fused kernels,
// the bulk of such work, are therefore run first over even slices of the observations, and the
// owner jobs then only add the terms, in the same order as ever: the bits do not change.
bool fused_terms_ahead(Sumo *sumo, const Scope &scope, uint32_t first, uint32_t last, uint32_t own_first,
                       uint32_t own_last, const ThreadHostInterface *host, const char *function, FusedAhead &ahead)
{
    std::vector<SumoObs *> obs;
    try {
        scope.walk([&](SumoStateVector *s) {
            if (!is_active(s) || s->index < own_first || s->index > own_last) return true;
            for (SumoObs *o = s->obs_active; o != nullptr; o = o->next_in_state[slot_of(o, s)])
                if (obs_lowest_in_range(o, s, first)) obs.push_back(o);
            return true;
        });
    } catch (const std::bad_alloc &) {
        return true;  // the build goes on without
    }
    return terms_ahead_of(sumo, obs, first, last, host, function, ahead);
}

// Evaluates the observations of the scope owned by states with index in [own_first,
// own_last], with Jacobians for [first, last]. Threaded, the owner range is cut into T
// contiguous sub-ranges, job j taking own_first + floor(j L / T) .. own_first +
// floor((j + 1) L / T) - 1 for L indices, into its own accumulators (the caller zeroes and
// combines them); otherwise it runs here, straight into the work copies.
bool evaluate_split(Sumo *sumo, const Scope &scope, uint32_t residual, uint32_t first, uint32_t last,
                    uint32_t own_first, uint32_t own_last, const ThreadHostInterface *host, const char *function)
{
    if (!threaded(sumo, host)) {
        SumoWorkspace *ws = job_workspaces(sumo, 1);
        if (ws == nullptr ||
            !evaluate_scope(sumo, ws, scope, residual, first, last, own_first, own_last, SUMO_NOT_IN_THREAD)) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return false;
        }
        return true;
    }
    const uint32_t T = sumo->n_threads;
    SumoWorkspace *ws = job_workspaces(sumo, T);
    if (ws == nullptr) return false;
    FusedAhead ahead;
    const AheadInUse in_use(sumo);
    if (!fused_terms_ahead(sumo, scope, first, last, own_first, own_last, host, function, ahead)) return false;
    const uint64_t L = uint64_t(own_last) - own_first + 1;
    std::vector<RangeJob> jobs(T);
    for (uint32_t j = 0; j < T; ++j) {
        const uint64_t lo = own_first + L * j / T, hi = own_first + L * (j + 1) / T;
        jobs[j] = RangeJob{sumo, job_ws(ws, j), &scope, residual, first, last, uint32_t(lo), uint32_t(hi - 1), j};
        // An empty sub-range is marked by own_first > own_last.
        if (hi == lo) jobs[j].own_first = 1, jobs[j].own_last = 0;
    }
    return run(host, range_job, jobs, function);
}

// Zeroes (add false) or adds into the work copies (add true) the thread accumulators of every
// active state of the model with index in [first, last] (first kAll: all) and of its blocks
// to such states: every accumulator a threaded evaluation with those Jacobians can write.
void gather_model(Sumo *sumo, uint32_t first, uint32_t last, bool add)
{
    const uint32_t T = sumo->n_threads;
    auto in = [&](const SumoStateVector *s) {
        return is_active(s) && (first == kAll || (s->index >= first && s->index <= last));
    };
    auto visit = [&](SumoStateVector *s) {
        if (!in(s)) return true;
        const uint32_t n = dim(s);
        for (uint32_t t = 0; t < T; ++t) {
            double *A = s->thread_blocks[t].A.data, *b = s->thread_blocks[t].b.data;
            if (add) {
                add_into(s->A_work.data, A, std::size_t(n) * n);
                add_into(s->b_work.data, b, n);
            } else {
                std::memset(A, 0, sizeof(double) * n * n);
                if (n > 0) std::memset(b, 0, sizeof(double) * n);
            }
        }
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            if (!in(k->col)) continue;
            const std::size_t count = std::size_t(k->M.rows) * k->M.cols;
            for (uint32_t t = 0; t < T; ++t) {
                if (add)
                    add_into(k->M_work.data, k->thread_blocks[t].data, count);
                else if (count > 0)
                    std::memset(k->thread_blocks[t].data, 0, sizeof(double) * count);
            }
        }
        return true;
    };
    walk_branch(sumo->root, visit);
}

// The index range of the observation owners: the scope's active states within [first, last]
// (first kAll: no limit). False when there are none.
bool owner_limits(const Scope &scope, uint32_t first, uint32_t last, uint32_t *lo, uint32_t *hi)
{
    if (scope.branch != nullptr)
        bSumoGetIndexLimitsBranch(scope.branch, lo, hi);
    else
        bSumoGetIndexLimitsStateRange(scope.first, scope.last, lo, hi);
    if (*lo == kAll) return false;
    if (first != kAll) {
        *lo = std::max(*lo, first);
        *hi = std::min(*hi, last);
    }
    return *lo <= *hi;
}

// The entry points' evaluation of a branch or run: every observation the scope owns within
// [first, last] (first kAll: all of them, with every Jacobian), added to the work copies.
bool evaluate_entry(Sumo *sumo, const Scope &scope, uint32_t first, uint32_t last, const ThreadHostInterface *host,
                    const char *function)
{
    if (!ensure_indices(sumo) || !create_blocks_scope(sumo, scope, first, last)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    uint32_t lo, hi;
    if (!owner_limits(scope, first, last, &lo, &hi)) return true;
    if (!threaded(sumo, host)) return evaluate_split(sumo, scope, 1, first, last, lo, hi, host, function);
    gather_model(sumo, first, last, false);
    if (!evaluate_split(sumo, scope, 1, first, last, lo, hi, host, function)) return false;
    gather_model(sumo, first, last, true);
    return true;
}

// The root build: one pass over the active list collects the counted observations (every
// state initialised) and makes their blocks; chunk j of T holds those numbered [jK/T,
// (j+1)K/T). With `cost` (residual flag set), the total cost at the current parameters comes
// out of the same evaluations, summed per chunk and then over the chunks in order, exactly
// as dSumoComputeResidual sums it.
bool build_root(Sumo *sumo, uint32_t residual, const ThreadHostInterface *host, const char *function, double *cost)
{
    const Scope all = Scope::of(sumo->root);
    if (!reset_scope(all, kAll, sumo->n_threads)) return false;
    std::vector<SumoObs *> counted;
    if (!collect_counted(sumo, sumo->obs_active, true, counted)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    const uint32_t T = sumo->n_threads;
    SumoWorkspace *ws = job_workspaces(sumo, T == 0 ? 1 : T);
    if (ws == nullptr) return false;
    const bool with_cost = cost != nullptr && residual != 0;
    const uint64_t K = counted.size(), chunks = (K + kCostChunk - 1) / kCostChunk;
    std::vector<double> sums;
    if (with_cost) {
        try {
            sums.assign(chunks, 0.0);
        } catch (const std::bad_alloc &) {
            PLX_ERR_START_AS(function, PLX_ERROR_MALLOC_FAILED, "cost chunks", 0);
            return false;
        }
    }
    // Jobs take whole chunks, so that each chunk's cost is summed by one job in list order.
    std::vector<RootJob> jobs(T == 0 ? 1 : T);
    for (uint32_t j = 0; j < jobs.size(); ++j) {
        const uint64_t begin = std::min(K, chunks * j / jobs.size() * kCostChunk);
        const uint64_t end = std::min(K, chunks * (j + 1) / jobs.size() * kCostChunk);
        jobs[j] = RootJob{sumo,           job_ws(ws, j), counted.data(), uint32_t(begin), uint32_t(end),
                          T == 0 ? SUMO_NOT_IN_THREAD : j, residual, with_cost ? sums.data() : nullptr};
    }
    if (T == 0) {
        if (!root_job(&jobs[0])) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return false;
        }
    } else {
        if (!run(host_for(host, obs_work(counted), kMinObsPerJob, T), root_job, jobs, function)) return false;
        if (!combine_scope(all, kAll, 0, T)) return false;
    }
    if (with_cost) {
        double sum = 0.0;
        for (const double c : sums) sum += c;
        *cost = sum;
    }
    return true;
}

}  // namespace

namespace sumo {

bool terms_ahead_of(Sumo *sumo, const std::vector<SumoObs *> &candidates, uint32_t first, uint32_t last,
                    const ThreadHostInterface *host, const char *function, FusedAhead &ahead)
{
    const uint32_t T = sumo->n_threads;
    if (host == nullptr || T == 0) return true;
    std::vector<SumoObs *> obs;
    try {
        for (SumoObs *o : candidates)
            if (has_fused_kernel(o) && obs_all_initialised(o)) obs.push_back(o);
        if (obs.size() < 2 || host_for(host, obs_work(obs), kMinObsPerJob, T) == nullptr) return true;
        ahead.terms.resize(obs.size());
        ahead.done.assign(obs.size(), 0);
        ahead.index.reserve(obs.size());
        for (uint32_t i = 0; i < obs.size(); ++i) ahead.index.emplace(obs[i], i);
    } catch (const std::bad_alloc &) {
        ahead = FusedAhead{};  // the evaluation goes on without
        return true;
    }
    ahead.first = first;
    ahead.last = last;
    const uint64_t K = obs.size();
    std::vector<AheadJob> jobs(T);
    for (uint32_t j = 0; j < T; ++j)
        jobs[j] = AheadJob{&ahead, obs.data(), uint32_t(K * j / T), uint32_t(K * (j + 1) / T)};
    if (!run(host, ahead_job, jobs, function)) return false;
    sumo->fused_ahead = &ahead;
    return true;
}

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
                 const ThreadHostInterface *host, const char *function, double *cost)
{
    if (!ensure_indices(sumo)) return false;
    if (scope.branch == sumo->root && first == kAll) return build_root(sumo, residual, host, function, cost);
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
    // The jobs split the owners' indices, not the whole span of the limits (a last of "all"
    // would leave every state to job 0).
    uint32_t lo, hi;
    if (owner_limits(scope, first, last, &lo, &hi) &&
        !evaluate_split(sumo, scope, residual, first, last, lo, hi, host, function))
        return false;
    return !threaded(sumo, host) || combine_scope(scope, last, 0, sumo->n_threads);
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
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return PLX_FALSE;
    return build_scope(sumo, scope, 1, first, last, host, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoEvaluateObsBranch(Sumo *sumo, SumoBranch *branch, uint32_t first, uint32_t last,
                                          const ThreadHostInterface *host)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    return evaluate_entry(sumo, Scope::of(branch), first, last, host, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoEvaluateObsStateRange(Sumo *sumo, SumoStateVector *first_state, SumoStateVector *last_state,
                                              uint32_t first, uint32_t last, const ThreadHostInterface *host)
{
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return PLX_FALSE;
    return evaluate_entry(sumo, scope, first, last, host, __func__) ? PLX_TRUE : PLX_FALSE;
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
    Scope scope;
    if (!open_run(sumo, first_state, last_state, true, __func__, &scope)) return PLX_FALSE;
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
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return PLX_FALSE;
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
    Scope scope;
    if (!open_run(first_state, last_state, __func__, &scope)) return PLX_FALSE;
    return scope.walk([&](SumoStateVector *s) { return bDampInformationMatrixState(s, lambda, mode) != 0; })
               ? PLX_TRUE
               : PLX_FALSE;
}

}  // extern "C"
