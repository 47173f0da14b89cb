// State numbering in elimination order and the index limits of branches and runs.
#include <algorithm>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

struct Counters {
    uint64_t active = 0;
    uint64_t uninit = 0;
};

bool number_branch(SumoBranch *b, Counters &c)
{
    if (b->sub != nullptr && !number_branch(b->sub, c)) return false;
    b->first_index = c.active > 0xFFFFFFFEu ? kAll : uint32_t(c.active);
    b->last_index = kAll;
    for (SumoStateVector *s = b->first; s != nullptr; s = s->next) {
        if (s->sub_branch != nullptr && !number_branch(s->sub_branch, c)) return false;
        uint64_t &counter = s->status == SUMO_STATE_UNINITIALISED ? c.uninit : c.active;
        if (counter > 0xFFFFFFFEu) return false;
        s->index = uint32_t(counter++);
        if (s->status != SUMO_STATE_UNINITIALISED) b->last_index = s->index;
    }
    return true;
}

// Lowest and highest active index in the subtree of a branch.
void limits_of(const SumoBranch *b, uint32_t &lo, uint32_t &hi)
{
    auto visit = [&](SumoStateVector *s) {
        if (is_active(s)) {
            lo = lo == kAll ? s->index : std::min(lo, s->index);
            hi = hi == kAll ? s->index : std::max(hi, s->index);
        }
        return true;
    };
    walk_branch(const_cast<SumoBranch *>(b), visit);
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoSetStateIndices(Sumo *sumo)
{
    if (sumo == nullptr || sumo->root == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    Counters c;
    if (!number_branch(sumo->root, c)) {
        PLX_ERR_START(PLX_ERROR_OUTSIDE_RANGE, "too many states to number", 0);
        return PLX_FALSE;
    }
    sumo->indices_valid = 1;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoGetIndexLimitsBranch(const SumoBranch *branch, uint32_t *first, uint32_t *last)
{
    if (branch == nullptr || first == nullptr || last == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    uint32_t lo = kAll, hi = kAll;
    limits_of(branch, lo, hi);
    *first = lo;
    *last = hi;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoGetIndexLimitsState(const SumoStateVector *state, uint32_t *first, uint32_t *last)
{
    if (state == nullptr || first == nullptr || last == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    *first = *last = kAll;
    if (!is_active(state)) return PLX_TRUE;
    uint32_t lo = kAll, hi = kAll;
    if (state->sub_branch != nullptr) limits_of(state->sub_branch, lo, hi);
    *first = lo != kAll ? std::min(lo, state->index) : state->index;
    *last = state->index;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoGetIndexLimitsStateRange(const SumoStateVector *first_state,
                                                 const SumoStateVector *last_state, uint32_t *first,
                                                 uint32_t *last)
{
    if (first == nullptr || last == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!range_reachable(first_state, last_state, __func__)) return PLX_FALSE;
    uint32_t lo = kAll, hi = kAll;
    auto visit = [&](SumoStateVector *s) {
        if (is_active(s)) {
            lo = lo == kAll ? s->index : std::min(lo, s->index);
            hi = hi == kAll ? s->index : std::max(hi, s->index);
        }
        return true;
    };
    walk_range(const_cast<SumoStateVector *>(first_state), const_cast<SumoStateVector *>(last_state), visit);
    *first = lo;
    *last = hi;
    return PLX_TRUE;
}

}  // extern "C"
