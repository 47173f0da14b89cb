// Branches: the tree the states hang on, which fixes the elimination order.
#include <cstdlib>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

SumoBranch *branch_alloc(uint32_t kind, void *parent, const char *function)
{
    auto *b = static_cast<SumoBranch *>(std::calloc(1, sizeof(SumoBranch)));
    if (b == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_MALLOC_FAILED, "SUMO branch", int64_t(sizeof(SumoBranch)));
        return nullptr;
    }
    b->first_index = kAll;
    b->last_index = kAll;
    b->kind = kind;
    b->parent = parent;
    return b;
}

// Puts the branch's sub-branch in its place under its parent.
bool unhook(Sumo *sumo, SumoBranch *branch, const char *function)
{
    SumoBranch *sub = branch->sub;
    switch (branch->kind) {
    case SUMO_BRANCH_FROM_BRANCH:
        static_cast<SumoBranch *>(branch->parent)->sub = sub;
        break;
    case SUMO_BRANCH_FROM_STATE:
        static_cast<SumoStateVector *>(branch->parent)->sub_branch = sub;
        break;
    case SUMO_BRANCH_ROOT:
        if (sub == nullptr) {
            PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "the root branch has nothing to take its place", 0);
            return false;
        }
        sumo->root = sub;
        break;
    default:
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "unknown branch kind", int64_t(branch->kind));
        return false;
    }
    if (sub != nullptr) {
        sub->kind = branch->kind;
        sub->parent = branch->parent;
    }
    branch->sub = nullptr;
    sumo->indices_valid = 0;
    return true;
}

}  // namespace

extern "C" {

PLANO_API SumoBranch *pSumoBranchRoot(void) { return branch_alloc(SUMO_BRANCH_ROOT, nullptr, __func__); }

PLANO_API SumoBranch *pSumoBranchNewFromBranch(Sumo *sumo, SumoBranch *branch)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    SumoBranch *b = branch_alloc(SUMO_BRANCH_FROM_BRANCH, branch, __func__);
    if (b == nullptr) return nullptr;
    b->sub = branch->sub;
    if (b->sub != nullptr) {
        b->sub->kind = SUMO_BRANCH_FROM_BRANCH;
        b->sub->parent = b;
    }
    branch->sub = b;
    sumo->indices_valid = 0;
    return b;
}

PLANO_API SumoBranch *pSumoBranchNewFromState(Sumo *sumo, SumoStateVector *state)
{
    if (sumo == nullptr || state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    if (state->sub_branch != nullptr || state->status == SUMO_STATE_ELIMINATED) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "state already has a branch or is eliminated", 0);
        return nullptr;
    }
    SumoBranch *b = branch_alloc(SUMO_BRANCH_FROM_STATE, state, __func__);
    if (b == nullptr) return nullptr;
    state->sub_branch = b;
    sumo->indices_valid = 0;
    return b;
}

PLANO_API Plx_Bool bSumoBranchCopy(Sumo *sumo, SumoBranch *dest, const SumoBranch *source, Plx_MemoryStack *ms,
                                   const ThreadHostInterface *host)
{
    if (sumo == nullptr || dest == nullptr || source == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    for (const SumoStateVector *s = source->first; s != nullptr; s = s->next)
        if (pSumoStateVectorCopy(s, sumo, dest, ms, host) == nullptr) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    if (source->sub != nullptr) {
        if (dest->sub == nullptr && pSumoBranchNewFromBranch(sumo, dest) == nullptr) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        if (!bSumoBranchCopy(sumo, dest->sub, source->sub, ms, host)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoBranchEliminate(Sumo *sumo, SumoWorkspace *workspace, SumoBranch *branch,
                                        uint32_t adjust_type, const ThreadHostInterface *host)
{
    if (sumo == nullptr || workspace == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (branch->sub != nullptr && !bSumoBranchEliminate(sumo, workspace, branch->sub, adjust_type, host)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    while (branch->first != nullptr) {
        SumoStateVector *s = branch->first;
        if (s->status == SUMO_STATE_UNINITIALISED) {
            // Nothing to marginalise: an uninitialised state (and what hangs from it) goes.
            if (s->sub_branch != nullptr && !bSumoBranchEliminate(sumo, workspace, s->sub_branch, adjust_type, host)) {
                PLX_ERR_PASS();
                return PLX_FALSE;
            }
            while (s->obs_active != nullptr)
                if (!bSumoObsDelete(sumo, workspace, s->obs_active, host)) {
                    PLX_ERR_PASS();
                    return PLX_FALSE;
                }
            if (!bSumoStateDelete(sumo, workspace, s, host)) {
                PLX_ERR_PASS();
                return PLX_FALSE;
            }
            continue;
        }
        if (!bSumoStateEliminate(sumo, workspace, s, adjust_type, host)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    if (branch == sumo->root && branch->sub == nullptr) return PLX_TRUE;  // the model keeps its root
    if (!unhook(sumo, branch, __func__)) return PLX_FALSE;
    std::free(branch);
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoBranchDelete(Sumo *sumo, SumoBranch *branch)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (branch->first != nullptr || branch->eliminated != nullptr) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "branch still holds states", 0);
        return PLX_FALSE;
    }
    if (!unhook(sumo, branch, __func__)) return PLX_FALSE;
    std::free(branch);
    return PLX_TRUE;
}

PLANO_API void vSumoBranchFree(Sumo *sumo, SumoBranch *branch, const ThreadHostInterface *host)
{
    if (branch == nullptr) return;
    vSumoBranchFree(sumo, branch->sub, host);
    vSumoStateVectorListFree(sumo, branch->first, host);
    vSumoStateVectorListFree(sumo, branch->eliminated, host);
    std::free(branch);
}

}  // extern "C"
