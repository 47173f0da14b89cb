// Off-diagonal information blocks: one per pair of states that share an observation (or
// that elimination filled in), kept in the row state's list by column index and in the
// column state's list by row index.
#include <cstdlib>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool pair_in(const SumoStateVector *s, uint32_t first, uint32_t last)
{
    return is_active(s) && dim(s) > 0 && (first == kAll || (s->index >= first && s->index <= last));
}

}  // namespace

namespace sumo {

bool create_obs_blocks(Sumo *sumo, const SumoObs *obs, uint32_t first, uint32_t last)
{
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        SumoStateVector *a = obs->states[i];
        if (a == nullptr || !pair_in(a, first, last)) continue;
        for (uint32_t j = i + 1; j < obs->n_states; ++j) {
            SumoStateVector *b = obs->states[j];
            if (b == nullptr || !pair_in(b, first, last)) continue;
            SumoOffdiag *blk;
            bool a_row;
            if (!block_between(sumo, a, b, true, &blk, &a_row)) return false;
        }
    }
    return true;
}

bool create_blocks_scope(Sumo *sumo, const Scope &scope, uint32_t first, uint32_t last)
{
    if (!ensure_indices(sumo)) return false;
    if (first == kAll && scope.branch == sumo->root) {
        for (SumoObs *o = sumo->obs_active; o != nullptr; o = o->next)
            if (obs_all_initialised(o) && !create_obs_blocks(sumo, o, kAll, kAll)) return false;
        return true;
    }
    return scope.walk([&](SumoStateVector *s) {
        if (!is_active(s) || (first != kAll && (s->index < first || s->index > last))) return true;
        for (SumoObs *o = s->obs_active; o != nullptr; o = o->next_in_state[slot_of(o, s)])
            if (obs_all_initialised(o) && obs_lowest_in_range(o, s, first) &&
                !create_obs_blocks(sumo, o, first, last))
                return false;
        return true;
    });
}

}  // namespace sumo

extern "C" {

PLANO_API SumoOffdiag *pSumoOffdiagNew(Sumo *sumo, SumoStateVector *row, SumoStateVector *col,
                                       SumoOffdiag *row_prev, SumoOffdiag *row_next, SumoOffdiag *col_prev,
                                       SumoOffdiag *col_next)
{
    if (sumo == nullptr || row == nullptr || col == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return nullptr;
    }
    const uint32_t r = dim(row), c = dim(col), T = sumo->n_threads;
    auto *blk = PLX_ALLOC(SumoOffdiag, 1);
    if (blk == nullptr) return nullptr;
    std::memset(blk, 0, sizeof(*blk));
    bool ok = form_mat(&blk->M, r, c, nullptr, __func__) && form_mat(&blk->M_work, r, c, nullptr, __func__) &&
              form_mat(&blk->M_cov, r, c, nullptr, __func__);
    if (ok && T > 0) {
        // Each job's accumulator starts on its own cache line: jobs add into the same blocks
        // at the same time.
        constexpr std::size_t kLine = 64 / sizeof(double);
        const std::size_t each = (std::size_t(r) * c + kLine - 1) / kLine * kLine;
        blk->thread_blocks = static_cast<Plx_Matrix *>(alloc_zero(nullptr, sizeof(Plx_Matrix) * T, __func__));
        auto *data = blk->thread_blocks != nullptr && each > 0
                         ? static_cast<double *>(std::aligned_alloc(64, sizeof(double) * each * T))
                         : nullptr;
        if (data != nullptr) std::memset(data, 0, sizeof(double) * each * T);
        if (data == nullptr && each == 0 && blk->thread_blocks != nullptr) {
            for (uint32_t t = 0; t < T; ++t) plx_mat_form_data(&blk->thread_blocks[t], r, c, nullptr);
        } else if (data == nullptr) {
            std::free(blk->thread_blocks);
            blk->thread_blocks = nullptr;
            ok = false;
        } else {
            for (uint32_t t = 0; t < T; ++t) plx_mat_form_data(&blk->thread_blocks[t], r, c, data + each * t);
        }
    }
    if (!ok) {
        plx_err_flush_trace();
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "matrix block", int64_t(sizeof(double) * r * c * (3 + T)));
        free_block(blk);
        return nullptr;
    }
    blk->row = row;
    blk->col = col;
    blk->row_prev = row_prev;
    blk->row_next = row_next;
    blk->col_prev = col_prev;
    blk->col_next = col_next;
    if (row_prev != nullptr) row_prev->row_next = blk;
    else if (row_next == row->row_blocks) row->row_blocks = blk;
    if (row_next != nullptr) row_next->row_prev = blk;
    if (col_prev != nullptr) col_prev->col_next = blk;
    else if (col_next == col->col_blocks) col->col_blocks = blk;
    if (col_next != nullptr) col_next->col_prev = blk;
    return blk;
}

PLANO_API Plx_Bool bSumoOffdiagSearchGen(Sumo *sumo, SumoStateVector *row, SumoStateVector *col, uint32_t create,
                                         SumoOffdiag *existing, SumoOffdiag *hint, SumoOffdiag **out)
{
    if (sumo == nullptr || row == nullptr || col == nullptr || out == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    *out = nullptr;
    // The column list is ordered by row index: walk from the hint towards the row's index.
    SumoOffdiag *k = (hint != nullptr && hint->col == col) ? hint : col->col_blocks;
    if (k != nullptr && k->row->index > row->index)
        for (; k != nullptr && k->row->index >= row->index; k = k->col_prev) {
            if (k->row == row) {
                *out = k;
                return PLX_TRUE;
            }
        }
    else
        for (; k != nullptr && k->row->index <= row->index; k = k->col_next) {
            if (k->row == row) {
                *out = k;
                return PLX_TRUE;
            }
        }
    if (!create || dim(row) == 0 || dim(col) == 0) return PLX_TRUE;
    SumoOffdiag *blk = existing;
    if (blk == nullptr) {
        blk = pSumoOffdiagNew(sumo, row, col, nullptr, nullptr, nullptr, nullptr);
        if (blk == nullptr) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        // pSumoOffdiagNew put it at the heads; re-link at the sorted places.
        unlink_row(blk);
        unlink_col(blk);
    }
    blk->row = row;
    blk->col = col;
    link_row_sorted(blk);
    link_col_sorted(blk);
    *out = blk;
    return PLX_TRUE;
}

PLANO_API void vSumoOffdiagCutoffRow(SumoOffdiag *first)
{
    for (SumoOffdiag *k = first; k != nullptr; k = k->row_next) unlink_col(k);
}

PLANO_API void vSumoOffdiagCutoffCol(SumoOffdiag *first)
{
    for (SumoOffdiag *k = first; k != nullptr;) {
        SumoOffdiag *next = k->col_next;
        unlink_row(k);
        k = next;
    }
}

PLANO_API void vSumoOffdiagFreeRow(Sumo *sumo, SumoOffdiag *first)
{
    (void)sumo;
    for (SumoOffdiag *k = first; k != nullptr;) {
        SumoOffdiag *next = k->row_next;
        free_block(k);
        k = next;
    }
}

PLANO_API void vSumoOffdiagFreeCol(Sumo *sumo, SumoOffdiag *first)
{
    (void)sumo;
    for (SumoOffdiag *k = first; k != nullptr;) {
        SumoOffdiag *next = k->col_next;
        free_block(k);
        k = next;
    }
}

PLANO_API Plx_Bool bSumoCreateOffdiagBlocksBranch(Sumo *sumo, SumoBranch *branch, uint32_t *first, uint32_t *last)
{
    if (sumo == nullptr || branch == nullptr || first == nullptr || last == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!ensure_indices(sumo)) return PLX_FALSE;
    uint32_t f = kAll, l = kAll;
    if (branch != sumo->root && !bSumoGetIndexLimitsBranch(branch, &f, &l)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    Scope scope;
    scope.branch = branch;
    if (f != kAll || branch == sumo->root) {
        if (!create_blocks_scope(sumo, scope, f, l)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    if (branch == sumo->root) {
        *first = 0;
        *last = kAll;
    } else {
        *first = f;
        *last = l;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoCreateOffdiagBlocksStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                      SumoStateVector *last_state, uint32_t *first,
                                                      uint32_t *last)
{
    if (first == nullptr || last == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    Scope scope;
    if (!open_run(sumo, first_state, last_state, true, __func__, &scope)) return PLX_FALSE;
    uint32_t f, l;
    if (!bSumoGetIndexLimitsStateRange(first_state, last_state, &f, &l)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (f == kAll && l != kAll) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "no active state in the range", 0);
        return PLX_FALSE;
    }
    if (f != kAll && !create_blocks_scope(sumo, scope, f, l)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    *first = f;
    *last = l;
    return PLX_TRUE;
}

}  // extern "C"
