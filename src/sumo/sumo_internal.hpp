// Helpers shared by the optimiser's source files: allocation from the heap or a memory
// stack, walks in elimination order, small dense kernels on raw row-major blocks, and the
// list surgery of observations and off-diagonal blocks.
#ifndef PLANO_SRC_SUMO_SUMO_INTERNAL_HPP
#define PLANO_SRC_SUMO_SUMO_INTERNAL_HPP

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "common/internal.hpp"
#include "plano/sumo.h"

namespace sumo {

constexpr uint32_t kAll = 0xFFFFFFFFu;

// ---- allocation ----

// bytes from ms when given, else from the heap; failures register code 5 (heap) or pass the
// stack's record on under `function`. The memory is zero-filled.
void *alloc_zero(Plx_MemoryStack *ms, std::size_t bytes, const char *function);
// Forms zero-filled records whose data come from ms when given (never freed one by one).
bool form_vec(Plx_Vector *v, uint32_t n, Plx_MemoryStack *ms, const char *function);
bool form_squ(Plx_SquMatrix *A, uint32_t n, Plx_MemoryStack *ms, const char *function);
bool form_mat(Plx_Matrix *M, uint32_t rows, uint32_t cols, Plx_MemoryStack *ms, const char *function);

// ---- walks in elimination order ----
// Every walk visits active and uninitialised states alike; `f` returns false to stop (the
// walk then returns false).

template <class F>
bool walk_branch(SumoBranch *b, F &f)
{
    if (b == nullptr) return true;
    if (b->sub != nullptr && !walk_branch(b->sub, f)) return false;
    for (SumoStateVector *s = b->first, *next; s != nullptr; s = next) {
        next = s->next;
        if (s->sub_branch != nullptr && !walk_branch(s->sub_branch, f)) return false;
        if (!f(s)) return false;
    }
    return true;
}

template <class F>
bool walk_branch_reverse(SumoBranch *b, F &f)
{
    if (b == nullptr) return true;
    for (SumoStateVector *s = b->last, *prev; s != nullptr; s = prev) {
        prev = s->prev;
        if (!f(s)) return false;
        if (s->sub_branch != nullptr && !walk_branch_reverse(s->sub_branch, f)) return false;
    }
    return walk_branch_reverse(b->sub, f);
}

// The run first..last through next, each state's hanging branch before it. A last state that
// cannot be reached from the first is code 7 (checked before anything is visited).
bool range_reachable(const SumoStateVector *first, const SumoStateVector *last, const char *function);

template <class F>
bool walk_range(SumoStateVector *first, SumoStateVector *last, F &f)
{
    for (SumoStateVector *s = first;; s = s->next) {
        SumoStateVector *const stop = s;
        if (s->sub_branch != nullptr && !walk_branch(s->sub_branch, f)) return false;
        if (!f(s)) return false;
        if (stop == last) return true;
    }
}

template <class F>
bool walk_range_reverse(SumoStateVector *first, SumoStateVector *last, F &f)
{
    for (SumoStateVector *s = last;; s = s->prev) {
        if (!f(s)) return false;
        if (s->sub_branch != nullptr && !walk_branch_reverse(s->sub_branch, f)) return false;
        if (s == first) return true;
    }
}

// A range of the model: a branch or a run of states.
struct Scope {
    SumoBranch *branch = nullptr;
    SumoStateVector *first = nullptr, *last = nullptr;

    template <class F>
    bool walk(F &&f) const
    {
        return branch != nullptr ? walk_branch(branch, f) : walk_range(first, last, f);
    }
    template <class F>
    bool walk_reverse(F &&f) const
    {
        return branch != nullptr ? walk_branch_reverse(branch, f) : walk_range_reverse(first, last, f);
    }
};

inline bool is_active(const SumoStateVector *s) { return s->status == SUMO_STATE_ACTIVE; }
inline uint32_t dim(const SumoStateVector *s) { return s->x.v.rows; }

// ---- small dense kernels (row-major, no checks) ----

// In-place Cholesky factor of the n x n symmetric a: lower triangle L, upper zeroed.
bool chol(double *a, uint32_t n);
// b = L^-1 b, b = L^-T b.
void fwd_v(const double *L, uint32_t n, double *b);
void bwd_v(const double *L, uint32_t n, double *b);
// B (n x m) = L^-1 B, B = L^-T B.
void fwd_m(const double *L, uint32_t n, double *B, uint32_t m);
void bwd_m(const double *L, uint32_t n, double *B, uint32_t m);
// out (n x n, full symmetric) = (L L^T)^-1.
void chol_inverse(const double *L, uint32_t n, double *out);
// C (n x m) += alpha A^T B for A (k x n), B (k x m).
void add_atb(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, uint32_t m, double *C);
// C (n x m) += alpha A B for A (n x k), B (k x m).
void add_ab(double alpha, const double *A, const double *B, uint32_t n, uint32_t k, uint32_t m, double *C);
// C (n x m) += alpha A B^T for A (n x k), B (m x k).
void add_abt(double alpha, const double *A, const double *B, uint32_t n, uint32_t k, uint32_t m, double *C);
// y (n) += alpha A x for A (n x m); y (m) += alpha A^T x for A (n x m).
void add_av(double alpha, const double *A, const double *x, uint32_t n, uint32_t m, double *y);
void add_atv(double alpha, const double *A, const double *x, uint32_t n, uint32_t m, double *y);
// y (n) += alpha (L L^T) x for a lower factor L.
void add_llt_v(double alpha, const double *L, const double *x, uint32_t n, double *y);
// Full dense copy of any square-matrix structure into out (n x n).
void squ_dense(const Plx_SquMatrix *A, double *out);
inline void add_into(double *dst, const double *src, std::size_t n)
{
    for (std::size_t i = 0; i < n; ++i) dst[i] += src[i];
}

// ---- model structure ----

// Slot of a state among an observation's states, or -1.
int slot_of(const SumoObs *obs, const SumoStateVector *s);
// True when every (non-null) state of the observation is initialised.
bool obs_all_initialised(const SumoObs *obs);
// True when no state of the observation has an index in [first, index of s).
bool obs_lowest_in_range(const SumoObs *obs, const SumoStateVector *s, uint32_t first);

// Per-state observation lists (active or eliminated heads chosen by `eliminated`).
void obs_link_states(SumoObs *obs, bool eliminated);
void obs_unlink_states(SumoObs *obs, bool eliminated);
// The Sumo's lists.
void obs_link_sumo(Sumo *sumo, SumoObs *obs, bool eliminated);
void obs_unlink_sumo(Sumo *sumo, SumoObs *obs, bool eliminated);

// The block between a and b oriented by index (lower index as row); with create, made when
// missing (blocks of a zero-dimension state are never made: *out null). *a_is_row tells the
// orientation.
bool block_between(Sumo *sumo, SumoStateVector *a, SumoStateVector *b, bool create, SumoOffdiag **out,
                   bool *a_is_row);
// Looks for a block between a and b in either state's row list (active or eliminated rows).
SumoOffdiag *find_any_block(SumoStateVector *a, SumoStateVector *b);
void unlink_row(SumoOffdiag *blk);
void unlink_col(SumoOffdiag *blk);
void link_row_sorted(SumoOffdiag *blk);
void link_col_sorted(SumoOffdiag *blk);
void free_block(SumoOffdiag *blk);
// Re-orients and re-sorts every active state's blocks after a renumbering that changed the
// relative order of states (moves and restores).
bool fix_block_orientation(Sumo *sumo, SumoWorkspace *workspace);
// Frees every block that touches the state (its row and column lists, and the blocks that
// eliminated states left to it), unlinking them from the other states.
void drop_state_blocks(SumoStateVector *s);

// Renumbers when a structural change made the indices stale.
bool ensure_indices(Sumo *sumo);

// State record and storage.
SumoStateVector *state_make(Sumo *sumo, uint32_t n, Plx_MemoryStack *ms, const char *function);
void branch_append(SumoBranch *b, SumoStateVector *s);
void branch_insert_before(SumoBranch *b, SumoStateVector *s, SumoStateVector *before);
void branch_cut(SumoStateVector *s);

// ---- workspaces ----

bool workspace_grow(SumoWorkspace *ws, uint32_t n);
// n workspaces kept in the Sumo for threaded jobs.
SumoWorkspace *job_workspaces(Sumo *sumo, uint32_t n);
void free_job_workspaces(Sumo *sumo);

// ---- solver internals shared between files ----

// The scope's index limits, with a first of kAll on the root standing for the whole model.
struct Limits {
    uint32_t first, last;
};
// Evaluates the observations owned by states of the scope whose index is in [own_first,
// own_last], with Jacobians for [first, last]; thread index as bSumoObsEvaluate.
bool evaluate_scope(Sumo *sumo, SumoWorkspace *ws, const Scope &scope, uint32_t residual, uint32_t first,
                    uint32_t last, uint32_t own_first, uint32_t own_last, uint32_t thread);
bool reset_scope(const Scope &scope, uint32_t last, uint32_t n_threads);
bool combine_scope(const Scope &scope, uint32_t last, uint32_t into_fixed, uint32_t n_threads);
bool build_scope(Sumo *sumo, const Scope &scope, uint32_t residual, uint32_t first, uint32_t last,
                 const ThreadHostInterface *host, const char *function);
bool increment_scope(Sumo *sumo, const Scope &scope, uint32_t first, uint32_t last);
bool adjust_info_vector_scope(const Scope &scope, uint32_t first, uint32_t last);
bool store_scope(const Scope &scope, const ThreadHostInterface *host);
bool reinstate_scope(Sumo *sumo, const Scope &scope);
bool eliminate_scope(const Scope &scope, Sumo *sumo, uint32_t solve, uint32_t last, int32_t *error_code,
                     const char *function);
bool back_substitute_scope(Sumo *sumo, const Scope &scope, SumoStateVector *target, uint32_t apply,
                           uint32_t first, uint32_t last);
double residual_scope(Sumo *sumo, const Scope &scope, const ThreadHostInterface *host, const char *function);
bool adjust_eliminated_states(Sumo *sumo);
// The same driven only by the active states with index in [first, last] (their b_work holds
// the increment).
bool adjust_eliminated_states_in(Sumo *sumo, uint32_t first, uint32_t last);
// The pieces of it: zero every eliminated state's increment, push one state's increment to
// the eliminated states linked to it, then apply and pass on the increments newest first.
void zero_eliminated_increments(Sumo *sumo);
void push_increment(const SumoStateVector *s, const double *delta);
bool cascade_eliminated(Sumo *sumo);
void init_elim_state_covariance(Sumo *sumo, SumoStateVector *target, bool covariance_mode);
bool compute_elim_state_covariance(Sumo *sumo, SumoStateVector *target);
bool create_blocks_scope(Sumo *sumo, const Scope &scope, uint32_t first, uint32_t last);
double obs_cost(Sumo *sumo, SumoWorkspace *ws, SumoObs *obs, const char *function);
// Evaluates an observation into the workspace (prediction, wanted Jacobians, residual,
// effective information and chi-squared); see evaluate.cpp.
bool evaluate_obs(Sumo *sumo, SumoWorkspace *ws, SumoObs *o, bool residual, bool decide, bool jacobians,
                  uint32_t first, uint32_t last, double *chi2);

}  // namespace sumo

#endif
