// Total costs: of the whole model (threaded by chunks of the observation lists), of a
// branch, a run of states or one state.
#include <algorithm>
#include <new>
#include <vector>

#include "common/job_batch.hpp"
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

struct CostJob {
    Sumo *sumo;
    SumoWorkspace *ws;
    const std::vector<SumoObs *> *obs;  // the counted observations, active then eliminated
    uint32_t chunk_begin, chunk_end;    // the job's chunks
    double *sums;                       // one per chunk
};

Plx_Bool cost_job(void *argument)
{
    auto *job = static_cast<CostJob *>(argument);
    const std::vector<SumoObs *> &obs = *job->obs;
    for (uint32_t k = job->chunk_begin; k < job->chunk_end; ++k) {
        const uint32_t begin = k * kCostChunk, count = uint32_t(std::min<std::size_t>(kCostChunk, obs.size() - begin));
        double sum = 0.0;
        for (uint32_t i = 0; i < count; ++i) {
            prefetch_obs(obs.data() + begin, i, count);
            const double c = obs_cost(job->sumo, job->ws, obs[begin + i], "dSumoComputeResidual");
            if (c == SUMO_FAILED_RESIDUAL) return PLX_FALSE;
            sum += c;
        }
        job->sums[k] = sum;
    }
    return PLX_TRUE;
}

}  // namespace

namespace sumo {

double residual_scope(Sumo *sumo, const Scope &scope, const ThreadHostInterface *host, const char *function)
{
    if (scope.branch == sumo->root) return dSumoComputeResidual(sumo, 0, host);
    if (!ensure_indices(sumo)) return SUMO_FAILED_RESIDUAL;
    uint32_t first, last;
    if (scope.branch != nullptr)
        bSumoGetIndexLimitsBranch(scope.branch, &first, &last);
    else
        bSumoGetIndexLimitsStateRange(scope.first, scope.last, &first, &last);
    if (first == kAll) return 0.0;
    SumoWorkspace *ws = job_workspaces(sumo, 1);
    if (ws == nullptr) return SUMO_FAILED_RESIDUAL;
    double sum = 0.0;
    const bool ok = scope.walk([&](SumoStateVector *s) {
        if (!is_active(s)) return true;
        for (SumoObs *o = s->obs_active; o != nullptr; o = o->next_in_state[slot_of(o, s)]) {
            if (!obs_all_initialised(o) || !obs_lowest_in_range(o, s, first)) continue;
            const double c = obs_cost(sumo, ws, o, function);
            if (c == SUMO_FAILED_RESIDUAL) return false;
            sum += c;
        }
        return true;
    });
    return ok ? sum : SUMO_FAILED_RESIDUAL;
}

}  // namespace sumo

extern "C" {

PLANO_API double dSumoComputeResidual(Sumo *sumo, uint32_t include_eliminated, const ThreadHostInterface *host)
{
    if (sumo == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return SUMO_FAILED_RESIDUAL;
    }
    const uint32_t T = sumo->n_threads == 0 ? 1 : sumo->n_threads;
    SumoWorkspace *ws = job_workspaces(sumo, T);
    if (ws == nullptr) return SUMO_FAILED_RESIDUAL;
    std::vector<SumoObs *> obs;  // the counted active observations, then the eliminated ones
    if (!collect_counted(sumo, sumo->obs_active, false, obs) ||
        (include_eliminated && !collect_counted(sumo, sumo->obs_eliminated, false, obs))) {
        PLX_ERR_PASS();
        return SUMO_FAILED_RESIDUAL;
    }
    std::vector<double> sums;
    try {
        sums.assign((obs.size() + kCostChunk - 1) / kCostChunk, 0.0);
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "cost chunks", 0);
        return SUMO_FAILED_RESIDUAL;
    }
    const uint64_t chunks = sums.size();
    std::vector<CostJob> jobs(T);
    for (uint32_t j = 0; j < T; ++j)
        jobs[j] = CostJob{sumo,       job_ws(ws, j), &obs, uint32_t(chunks * j / T), uint32_t(chunks * (j + 1) / T),
                          sums.data()};
    std::vector<ThreadedWorker *> workers(T, nullptr);
    const ThreadHostInterface *run_on =
        sumo->n_threads == 0 ? nullptr : host_for(host, obs_work(obs), kMinObsPerJob, T);
    const plano::JobsResult r = plano::run_jobs(run_on, cost_job, jobs.data(), sizeof(CostJob), T, workers.data());
    if (r != plano::JobsResult::ok) {
        PLX_ERR_PASS_MSG(plano::jobs_failure_message(r), 0);
        return SUMO_FAILED_RESIDUAL;
    }
    double sum = 0.0;
    for (const double c : sums) sum += c;
    return sum;
}

PLANO_API double dSumoComputeResidualBranch(Sumo *sumo, SumoBranch *branch, const ThreadHostInterface *host)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return SUMO_FAILED_RESIDUAL;
    }
    Scope scope;
    scope.branch = branch;
    return residual_scope(sumo, scope, host, __func__);
}

PLANO_API double dSumoComputeResidualStateRange(Sumo *sumo, SumoStateVector *first_state, SumoStateVector *last_state,
                                                const ThreadHostInterface *host)
{
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return SUMO_FAILED_RESIDUAL;
    return residual_scope(sumo, scope, host, __func__);
}

PLANO_API double dSumoComputeResidualState(Sumo *sumo, SumoStateVector *state, const ThreadHostInterface *host)
{
    return dSumoComputeResidualStateRange(sumo, state, state, host);
}

}  // extern "C"
