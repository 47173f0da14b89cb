// One Levenberg-Marquardt (or Gauss-Newton) iteration on a branch or a run of states.
#include <algorithm>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool failed_cost(double c) { return c == SUMO_FAILED_RESIDUAL; }

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoLevMarqIterationBranchGen(Sumo *sumo, SumoBranch *branch, SumoStateVector *target,
                                                  uint32_t apply, double lambda, uint32_t mode, uint32_t first,
                                                  uint32_t last, uint32_t *accepted, double *reduction,
                                                  const ThreadHostInterface *host)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (accepted != nullptr) *accepted = 0;
    if (reduction != nullptr) *reduction = 0.0;
    if (!ensure_indices(sumo)) return PLX_FALSE;
    Scope scope;
    scope.branch = branch;
    if (!store_scope(scope, host)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    // The whole model's build evaluates every counted observation at the stored parameters
    // with its residual, which is all the cost needs: a stale cost comes out of the build.
    const bool stale = accepted != nullptr && (sumo->modified || sumo->cache_branch != branch);
    const bool cost_from_build = stale && apply && branch == sumo->root && first == kAll;
    if (accepted == nullptr) {
        sumo->residual = 0.0;
        sumo->modified = 1;
        sumo->cache_first = sumo->cache_last = nullptr;
        sumo->cache_branch = nullptr;
    } else if (stale && !cost_from_build) {
        const double c = residual_scope(sumo, scope, host, __func__);
        if (failed_cost(c)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        sumo->residual = c;
        sumo->modified = 0;
        sumo->cache_branch = branch;
        sumo->cache_first = sumo->cache_last = nullptr;
    }
    // After a rejected step the root branch's build would repeat the previous one.
    const bool reusable = accepted != nullptr && apply && branch == sumo->root;
    double c0 = 0.0;
    if (!(reusable && !stale && build_cache_restore(sumo, first, last))) {
        if (!build_scope(sumo, scope, apply, first, last, host, __func__, cost_from_build ? &c0 : nullptr)) {
            build_cache_drop(sumo);
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        if (reusable)
            build_cache_take(sumo, first, last);
        else
            build_cache_drop(sumo);
    }
    if (cost_from_build) {
        sumo->residual = c0;
        sumo->modified = 0;
        sumo->cache_branch = branch;
        sumo->cache_first = sumo->cache_last = nullptr;
    }
    if (lambda != 0.0 && !bDampInformationMatrixBranch(branch, lambda, mode)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    int32_t code = 0;
    if (!eliminate_scope(scope, sumo, apply, last, &code, __func__)) {
        if (code == 0) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        return PLX_TRUE;  // not positive definite: the step is rejected, parameters untouched
    }
    sumo->covariance_done = 0;
    // A step clears the eliminated states' covariances when it is rejected, or while it
    // carries them along when it is accepted: one walk of that long list instead of two.
    if (!apply) init_elim_state_covariance(sumo, target, true);
    if (!back_substitute_scope(sumo, scope, target, apply, first, last)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (!apply) {
        if (target != nullptr && target->status == SUMO_STATE_ELIMINATED &&
            !compute_elim_state_covariance(sumo, target)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        sumo->covariance_done = 1;
        return PLX_TRUE;
    }
    if (!increment_scope(sumo, scope, first, last)) {
        init_elim_state_covariance(sumo, nullptr, false);
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    const double c1 = (accepted != nullptr || reduction != nullptr) ? residual_scope(sumo, scope, host, __func__) : 0.0;
    if (failed_cost(c1)) {
        init_elim_state_covariance(sumo, nullptr, false);
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (accepted != nullptr && c1 >= sumo->residual) {
        init_elim_state_covariance(sumo, nullptr, false);
        if (!reinstate_scope(sumo, scope)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        return PLX_TRUE;
    }
    if (!adjust_eliminated_states_in(sumo, first, last) ||
        !adjust_info_vector_scope(scope, first == kAll ? 0 : first, last)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (reduction != nullptr) *reduction = sumo->residual - c1;
    if (accepted != nullptr) {
        sumo->residual = c1;
        *accepted = 1;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoLevMarqIterationStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                   SumoStateVector *last_state, double lambda, uint32_t mode,
                                                   uint32_t first, uint32_t last, uint32_t *accepted,
                                                   double *reduction, const ThreadHostInterface *host)
{
    if (accepted != nullptr) *accepted = 0;
    if (reduction != nullptr) *reduction = 0.0;
    Scope scope;
    if (!open_run(sumo, first_state, last_state, true, __func__, &scope)) return PLX_FALSE;
    build_cache_drop(sumo);
    if (!build_scope(sumo, scope, 1, first, last, host, __func__)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (accepted != nullptr) {
        if (sumo->modified || sumo->cache_first != first_state || sumo->cache_last != last_state ||
            sumo->cache_branch != nullptr) {
            const double c = residual_scope(sumo, scope, host, __func__);
            if (failed_cost(c)) {
                PLX_ERR_PASS();
                return PLX_FALSE;
            }
            sumo->residual = c;
            sumo->modified = 0;
            sumo->cache_first = first_state;
            sumo->cache_last = last_state;
            sumo->cache_branch = nullptr;
        }
        if (!store_scope(scope, host)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    if (lambda != 0.0 && !bDampInformationMatrixStateRange(first_state, last_state, lambda, mode)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    int32_t code = 0;
    if (!eliminate_scope(scope, sumo, 1, last, &code, __func__)) {
        if (code == 0) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        return PLX_TRUE;
    }
    if (!back_substitute_scope(sumo, scope, nullptr, 1, first, last) || !increment_scope(sumo, scope, first, last)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    const double c1 = residual_scope(sumo, scope, host, __func__);
    if (failed_cost(c1)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (accepted != nullptr && c1 >= sumo->residual) {
        if (!reinstate_scope(sumo, scope)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        return PLX_TRUE;
    }
    uint32_t lo = kAll, hi = kAll;
    bSumoGetIndexLimitsStateRange(first_state, last_state, &lo, &hi);
    if (first != kAll) {
        lo = std::max(lo, first);
        hi = std::min(hi, last);
    }
    if (!adjust_info_vector_scope(scope, lo, hi)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (reduction != nullptr) *reduction = sumo->residual - c1;
    sumo->residual = c1;
    if (accepted != nullptr) *accepted = 1;
    return PLX_TRUE;
}

}  // extern "C"
