// The optimiser's list surgery: observations in per-state and model lists, off-diagonal
// blocks in their row and column lists, states in branches, and storage for records taken
// from the heap or a memory stack.
#include <algorithm>
#include <cstdlib>
#include <new>
#include <vector>

#include "sumo/sumo_internal.hpp"

namespace sumo {

// ---- allocation ----

void *alloc_zero(Plx_MemoryStack *ms, std::size_t bytes, const char *function)
{
    void *p;
    if (ms != nullptr) {
        p = plx_memory_stack_alloc(ms, bytes == 0 ? 1 : bytes);
        if (p == nullptr) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return nullptr;
        }
    } else {
        p = plx::heap_alloc<unsigned char>(bytes, function, __FILE__, __LINE__);
        if (p == nullptr) return nullptr;
    }
    std::memset(p, 0, bytes == 0 ? 1 : bytes);
    return p;
}

bool form_vec(Plx_Vector *v, uint32_t n, Plx_MemoryStack *ms, const char *function)
{
    if (ms != nullptr) {
        auto *d = static_cast<double *>(alloc_zero(ms, sizeof(double) * n, function));
        return d != nullptr && plx_vec_form_data(v, n, d) != nullptr;
    }
    if (plx_vec_form(v, n) == nullptr) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    std::memset(v->data, 0, sizeof(double) * n);
    return true;
}

bool form_squ(Plx_SquMatrix *A, uint32_t n, Plx_MemoryStack *ms, const char *function)
{
    const std::size_t count = std::size_t(n) * n;
    if (ms != nullptr) {
        auto *d = static_cast<double *>(alloc_zero(ms, sizeof(double) * count, function));
        return d != nullptr && plx_squmat_form_data(A, PLX_SQUMAT_SYMMETRIC, n, d) != nullptr;
    }
    if (plx_squmat_form(A, PLX_SQUMAT_SYMMETRIC, n) == nullptr) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    std::memset(A->data, 0, sizeof(double) * count);
    return true;
}

bool form_mat(Plx_Matrix *M, uint32_t rows, uint32_t cols, Plx_MemoryStack *ms, const char *function)
{
    const std::size_t count = std::size_t(rows) * cols;
    if (ms != nullptr) {
        auto *d = static_cast<double *>(alloc_zero(ms, sizeof(double) * count, function));
        return d != nullptr && plx_mat_form_data(M, rows, cols, d) != nullptr;
    }
    if (plx_mat_form(M, rows, cols) == nullptr) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    std::memset(M->data, 0, sizeof(double) * count);
    return true;
}

bool range_reachable(const SumoStateVector *first, const SumoStateVector *last, const char *function)
{
    if (first == nullptr || last == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null state", 0);
        return false;
    }
    for (const SumoStateVector *s = first; s != nullptr; s = s->next)
        if (s == last) return true;
    PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "last state not reachable from first", 0);
    return false;
}

bool open_run(SumoStateVector *first, SumoStateVector *last, const char *function, Scope *scope)
{
    if (!range_reachable(first, last, function)) return false;
    *scope = Scope::run(first, last);
    return true;
}

bool open_run(Sumo *sumo, SumoStateVector *first, SumoStateVector *last, bool renumber, const char *function,
              Scope *scope)
{
    if (sumo == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return false;
    }
    if (!open_run(first, last, function, scope)) return false;
    if (renumber && !ensure_indices(sumo)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    return true;
}

// ---- observations ----

int slot_of(const SumoObs *obs, const SumoStateVector *s)
{
    for (uint32_t i = 0; i < obs->n_states; ++i)
        if (obs->states[i] == s) return int(i);
    return -1;
}

bool obs_all_initialised(const SumoObs *obs)
{
    for (uint32_t i = 0; i < obs->n_states; ++i)
        if (obs->states[i] != nullptr && obs->states[i]->status == SUMO_STATE_UNINITIALISED) return false;
    return true;
}

bool obs_lowest_in_range(const SumoObs *obs, const SumoStateVector *s, uint32_t first)
{
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        const SumoStateVector *t = obs->states[i];
        if (t == nullptr || t == s || !is_active(t)) continue;
        if (t->index < s->index && (first == kAll || t->index >= first)) return false;
    }
    return true;
}

static SumoObs *&state_head(SumoStateVector *s, bool eliminated)
{
    return eliminated ? s->obs_eliminated : s->obs_active;
}

void obs_link_states(SumoObs *obs, bool eliminated)
{
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        SumoStateVector *s = obs->states[i];
        if (s == nullptr) continue;
        SumoObs *&head = state_head(s, eliminated);
        obs->next_in_state[i] = head;
        obs->prev_in_state[i] = nullptr;
        if (head != nullptr) head->prev_in_state[slot_of(head, s)] = obs;
        head = obs;
    }
}

void obs_unlink_states(SumoObs *obs, bool eliminated)
{
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        SumoStateVector *s = obs->states[i];
        if (s == nullptr) continue;
        SumoObs *prev = obs->prev_in_state[i], *next = obs->next_in_state[i];
        if (prev != nullptr)
            prev->next_in_state[slot_of(prev, s)] = next;
        else
            state_head(s, eliminated) = next;
        if (next != nullptr) next->prev_in_state[slot_of(next, s)] = prev;
        obs->prev_in_state[i] = obs->next_in_state[i] = nullptr;
    }
}

void obs_link_sumo(Sumo *sumo, SumoObs *obs, bool eliminated)
{
    SumoObs *&head = eliminated ? sumo->obs_eliminated : sumo->obs_active;
    obs->prev = nullptr;
    obs->next = head;
    if (head != nullptr) head->prev = obs;
    head = obs;
}

void obs_unlink_sumo(Sumo *sumo, SumoObs *obs, bool eliminated)
{
    SumoObs *&head = eliminated ? sumo->obs_eliminated : sumo->obs_active;
    if (obs->prev != nullptr)
        obs->prev->next = obs->next;
    else
        head = obs->next;
    if (obs->next != nullptr) obs->next->prev = obs->prev;
    obs->prev = obs->next = nullptr;
}

// ---- off-diagonal blocks ----

void unlink_row(SumoOffdiag *blk)
{
    if (blk->row_prev != nullptr)
        blk->row_prev->row_next = blk->row_next;
    else if (blk->row->row_blocks == blk)
        blk->row->row_blocks = blk->row_next;
    if (blk->row_next != nullptr) blk->row_next->row_prev = blk->row_prev;
    blk->row_prev = blk->row_next = nullptr;
}

void unlink_col(SumoOffdiag *blk)
{
    if (blk->col_prev != nullptr)
        blk->col_prev->col_next = blk->col_next;
    else if (blk->col->col_blocks == blk)
        blk->col->col_blocks = blk->col_next;
    if (blk->col_next != nullptr) blk->col_next->col_prev = blk->col_prev;
    blk->col_prev = blk->col_next = nullptr;
}

void link_row_sorted(SumoOffdiag *blk)
{
    SumoStateVector *r = blk->row;
    SumoOffdiag *prev = nullptr, *cur = r->row_blocks;
    while (cur != nullptr && cur->col->index <= blk->col->index) {
        prev = cur;
        cur = cur->row_next;
    }
    blk->row_prev = prev;
    blk->row_next = cur;
    if (prev != nullptr)
        prev->row_next = blk;
    else
        r->row_blocks = blk;
    if (cur != nullptr) cur->row_prev = blk;
}

void link_col_sorted(SumoOffdiag *blk)
{
    SumoStateVector *c = blk->col;
    SumoOffdiag *prev = nullptr, *cur = c->col_blocks;
    while (cur != nullptr && cur->row->index <= blk->row->index) {
        prev = cur;
        cur = cur->col_next;
    }
    blk->col_prev = prev;
    blk->col_next = cur;
    if (prev != nullptr)
        prev->col_next = blk;
    else
        c->col_blocks = blk;
    if (cur != nullptr) cur->col_prev = blk;
}

void free_block(SumoOffdiag *blk)
{
    if (blk == nullptr) return;
    plx_mat_free(&blk->M);
    plx_mat_free(&blk->M_work);
    plx_mat_free(&blk->M_cov);
    if (blk->thread_blocks != nullptr) {
        // Every per-thread matrix lies in one block of doubles starting at the first's data.
        std::free(blk->thread_blocks[0].data);
        std::free(blk->thread_blocks);
    }
    std::free(blk);
}

bool block_between(Sumo *sumo, SumoStateVector *a, SumoStateVector *b, bool create, SumoOffdiag **out,
                   bool *a_is_row)
{
    *out = nullptr;
    *a_is_row = true;
    if (dim(a) == 0 || dim(b) == 0) return true;
    if (a->index == kAll || b->index == kAll || a->index == b->index) {
        PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "state without a valid index", 0);
        return false;
    }
    *a_is_row = a->index < b->index;
    SumoStateVector *row = *a_is_row ? a : b, *col = *a_is_row ? b : a;
    if (!bSumoOffdiagSearchGen(sumo, row, col, create ? 1u : 0u, nullptr, nullptr, out)) {
        PLX_ERR_PASS();
        return false;
    }
    return true;
}

SumoOffdiag *find_any_block(SumoStateVector *a, SumoStateVector *b)
{
    for (SumoOffdiag *k = a->row_blocks; k != nullptr; k = k->row_next)
        if (k->col == b) return k;
    for (SumoOffdiag *k = b->row_blocks; k != nullptr; k = k->row_next)
        if (k->col == a) return k;
    return nullptr;
}

static void transpose_into(Plx_Matrix *m, std::vector<double> &scratch)
{
    const uint32_t r = m->rows, c = m->cols;
    scratch.assign(m->data, m->data + std::size_t(r) * c);
    for (uint32_t i = 0; i < r; ++i)
        for (uint32_t j = 0; j < c; ++j) m->data[std::size_t(j) * r + i] = scratch[std::size_t(i) * c + j];
    m->rows = c;
    m->cols = r;
}

bool fix_block_orientation(Sumo *sumo, SumoWorkspace *workspace)
{
    (void)workspace;
    std::vector<SumoOffdiag *> blocks;
    try {
        auto collect = [&](SumoStateVector *s) {
            for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) blocks.push_back(k);
            return true;
        };
        walk_branch(sumo->root, collect);
        auto clear = [&](SumoStateVector *s) {
            s->row_blocks = s->col_blocks = nullptr;
            return true;
        };
        walk_branch(sumo->root, clear);
        std::vector<double> scratch;
        for (SumoOffdiag *k : blocks) {
            k->row_prev = k->row_next = k->col_prev = k->col_next = nullptr;
            if (k->row->index > k->col->index) {
                std::swap(k->row, k->col);
                transpose_into(&k->M, scratch);
                transpose_into(&k->M_work, scratch);
                transpose_into(&k->M_cov, scratch);
                for (uint32_t t = 0; t < sumo->n_threads; ++t) transpose_into(&k->thread_blocks[t], scratch);
            }
            link_row_sorted(k);
            link_col_sorted(k);
        }
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "block list", 0);
        return false;
    }
    return true;
}

static void list_remove(Plx_List *list, const void *data)
{
    for (list->current = list->head; list->current != nullptr;) {
        if (list->current->data == data) {
            plx_list_delete_current(list, nullptr);
            return;
        }
        list->current = list->current->next;
    }
}

void drop_state_blocks(SumoStateVector *s)
{
    while (s->row_blocks != nullptr) {
        SumoOffdiag *k = s->row_blocks;
        unlink_row(k);
        if (s->status == SUMO_STATE_ELIMINATED)
            list_remove(&k->col->elim_blocks, k);
        else
            unlink_col(k);
        free_block(k);
    }
    while (s->col_blocks != nullptr) {
        SumoOffdiag *k = s->col_blocks;
        unlink_col(k);
        unlink_row(k);
        free_block(k);
    }
    for (Plx_ListNode *n = s->elim_blocks.head; n != nullptr; n = n->next) {
        auto *k = static_cast<SumoOffdiag *>(n->data);
        unlink_row(k);
        free_block(k);
    }
    plx_list_delete_all(&s->elim_blocks, nullptr);
}

bool ensure_indices(Sumo *sumo)
{
    if (sumo->indices_valid) return true;
    if (!bSumoSetStateIndices(sumo)) {
        PLX_ERR_PASS();
        return false;
    }
    return true;
}

// ---- states ----

SumoStateVector *state_make(Sumo *sumo, uint32_t n, Plx_MemoryStack *ms, const char *function)
{
    auto *s = static_cast<SumoStateVector *>(alloc_zero(ms, sizeof(SumoStateVector), function));
    if (s == nullptr) return nullptr;
    s->owned = ms == nullptr ? 1u : 0u;
    s->index = kAll;
    s->jacobian_step = 1e-7;
    s->x.type = SUMO_UNSET_LABEL;
    s->x.label = SUMO_UNSET_LABEL;
    plx_list_form(&s->elim_blocks);
    const uint32_t T = sumo->n_threads;
    bool ok = form_vec(&s->x.v, n, ms, function) && form_vec(&s->x_old, n, ms, function) &&
              form_squ(&s->A, n, ms, function) && form_squ(&s->A_work, n, ms, function) &&
              form_vec(&s->b, n, ms, function) && form_vec(&s->b_work, n, ms, function) &&
              form_squ(&s->covariance, n, ms, function);
    if (ok && T > 0) {
        s->thread_blocks = static_cast<SumoThreadBlock *>(alloc_zero(ms, sizeof(SumoThreadBlock) * T, function));
        ok = s->thread_blocks != nullptr;
        for (uint32_t t = 0; ok && t < T; ++t)
            ok = form_squ(&s->thread_blocks[t].A, n, ms, function) && form_vec(&s->thread_blocks[t].b, n, ms, function);
    }
    if (!ok) {
        vSumoStateVectorFree(sumo, s, nullptr);
        return nullptr;
    }
    return s;
}

void branch_append(SumoBranch *b, SumoStateVector *s)
{
    s->branch = b;
    s->next = nullptr;
    s->prev = b->last;
    if (b->last != nullptr)
        b->last->next = s;
    else
        b->first = s;
    b->last = s;
}

void branch_insert_before(SumoBranch *b, SumoStateVector *s, SumoStateVector *before)
{
    s->branch = b;
    s->next = before;
    s->prev = before->prev;
    if (before->prev != nullptr)
        before->prev->next = s;
    else
        b->first = s;
    before->prev = s;
}

void branch_cut(SumoStateVector *s)
{
    SumoBranch *b = s->branch;
    if (b == nullptr) return;
    if (s->prev != nullptr)
        s->prev->next = s->next;
    else
        b->first = s->next;
    if (s->next != nullptr)
        s->next->prev = s->prev;
    else
        b->last = s->prev;
    s->prev = s->next = nullptr;
    s->branch = nullptr;
}

// ---- workspaces ----

bool workspace_grow(SumoWorkspace *ws, uint32_t n)
{
    if (n <= ws->capacity) return true;
    const std::size_t bytes = std::size_t(32) * n;
    auto *J = static_cast<Plx_Matrix *>(std::realloc(ws->jacobians, sizeof(Plx_Matrix) * n));
    if (J == nullptr) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "", int64_t(bytes));
        return false;
    }
    ws->jacobians = J;
    auto *NJ = static_cast<Plx_Matrix *>(std::realloc(ws->nj, sizeof(Plx_Matrix) * n));
    if (NJ == nullptr) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "", int64_t(bytes));
        return false;
    }
    ws->nj = NJ;
    auto *P = static_cast<Plx_Matrix **>(std::realloc(ws->jacobian_ptrs, sizeof(Plx_Matrix *) * n));
    if (P == nullptr) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "", int64_t(bytes));
        return false;
    }
    ws->jacobian_ptrs = P;
    for (uint32_t i = ws->capacity; i < n; ++i) {
        ws->jacobians[i] = Plx_Matrix{0, 0, nullptr, 0, 0, 0};
        ws->nj[i] = Plx_Matrix{0, 0, nullptr, 0, 0, 0};
        ws->jacobian_ptrs[i] = nullptr;
    }
    ws->capacity = n;
    return true;
}

SumoWorkspace *job_workspaces(Sumo *sumo, uint32_t n)
{
    const uint32_t records = n * kWorkspaceStride;
    if (records <= sumo->n_job_workspaces) return sumo->job_workspaces;
    auto *w = static_cast<SumoWorkspace *>(std::realloc(sumo->job_workspaces, sizeof(SumoWorkspace) * records));
    if (w == nullptr) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "workspaces", int64_t(sizeof(SumoWorkspace) * records));
        return nullptr;
    }
    sumo->job_workspaces = w;
    for (uint32_t i = sumo->n_job_workspaces; i < records; ++i) pSumoWorkspaceForm(&w[i]);
    sumo->n_job_workspaces = records;
    return w;
}

bool collect_counted(Sumo *sumo, SumoObs *head, bool make_blocks, std::vector<SumoObs *> &out)
{
    try {
        for (SumoObs *o = head; o != nullptr; o = o->next) {
            if (!obs_all_initialised(o)) continue;
            if (make_blocks && !create_obs_blocks(sumo, o, kAll, kAll)) return false;
            out.push_back(o);
        }
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "observation list", int64_t(sizeof(SumoObs *) * out.size()));
        return false;
    }
    return true;
}

void free_job_workspaces(Sumo *sumo)
{
    for (uint32_t i = 0; i < sumo->n_job_workspaces; ++i) vSumoWorkspaceFree(&sumo->job_workspaces[i]);
    std::free(sumo->job_workspaces);
    sumo->job_workspaces = nullptr;
    sumo->n_job_workspaces = 0;
}

}  // namespace sumo
