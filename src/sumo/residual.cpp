// Total costs: of the whole model (threaded by chunks of the observation lists), of a
// branch, a run of states or one state.
#include <vector>

#include "common/job_batch.hpp"
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

struct CostJob {
    Sumo *sumo;
    SumoWorkspace *ws;
    SumoObs *const *active;  // the job's chunk of the counted active observations
    uint32_t n_active;
    SumoObs *const *eliminated;  // and of the eliminated ones
    uint32_t n_eliminated;
    double sum;
};

double chunk_cost(Sumo *sumo, SumoWorkspace *ws, SumoObs *const *obs, uint32_t count)
{
    double sum = 0.0;
    for (uint32_t i = 0; i < count; ++i) {
        prefetch_obs(obs, i, count);
        const double c = obs_cost(sumo, ws, obs[i], "dSumoComputeResidual");
        if (c == SUMO_FAILED_RESIDUAL) return c;
        sum += c;
    }
    return sum;
}

Plx_Bool cost_job(void *argument)
{
    auto *job = static_cast<CostJob *>(argument);
    const double a = chunk_cost(job->sumo, job->ws, job->active, job->n_active);
    const double e = a == SUMO_FAILED_RESIDUAL ? a : chunk_cost(job->sumo, job->ws, job->eliminated, job->n_eliminated);
    job->sum = e == SUMO_FAILED_RESIDUAL ? e : a + e;
    return job->sum == SUMO_FAILED_RESIDUAL ? PLX_FALSE : PLX_TRUE;
}

// T consecutive chunks of the counted observations: chunk j holds those numbered [jK/T,
// (j+1)K/T).
void chunk_list(const std::vector<SumoObs *> &counted, uint32_t T, std::vector<SumoObs *const *> &start,
                std::vector<uint32_t> &count)
{
    const uint64_t K = counted.size();
    for (uint32_t j = 0; j < T; ++j) {
        const uint64_t begin = K * j / T, end = K * (j + 1) / T;
        start[j] = counted.data() + begin;
        count[j] = uint32_t(end - begin);
    }
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
    std::vector<SumoObs *> active, eliminated;
    if (!collect_counted(sumo, sumo->obs_active, false, active) ||
        (include_eliminated && !collect_counted(sumo, sumo->obs_eliminated, false, eliminated))) {
        PLX_ERR_PASS();
        return SUMO_FAILED_RESIDUAL;
    }
    std::vector<SumoObs *const *> a_start(T), e_start(T);
    std::vector<uint32_t> a_count(T), e_count(T, 0);
    chunk_list(active, T, a_start, a_count);
    chunk_list(eliminated, T, e_start, e_count);
    std::vector<CostJob> jobs(T);
    for (uint32_t j = 0; j < T; ++j)
        jobs[j] = CostJob{sumo, job_ws(ws, j), a_start[j], a_count[j], e_start[j], e_count[j], 0.0};
    std::vector<ThreadedWorker *> workers(T, nullptr);
    const ThreadHostInterface *run_on =
        sumo->n_threads == 0 ? nullptr : host_for(host, active.size() + eliminated.size(), kMinObsPerJob, T);
    const plano::JobsResult r = plano::run_jobs(run_on, cost_job, jobs.data(), sizeof(CostJob), T, workers.data());
    if (r != plano::JobsResult::ok) {
        PLX_ERR_PASS_MSG(plano::jobs_failure_message(r), 0);
        return SUMO_FAILED_RESIDUAL;
    }
    double sum = 0.0;
    for (const CostJob &job : jobs) sum += job.sum;
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
