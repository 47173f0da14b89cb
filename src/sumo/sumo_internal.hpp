// Helpers shared by the optimiser's source files: allocation from the heap or a memory
// stack, walks in elimination order, small dense kernels on raw row-major blocks, and the
// list surgery of observations and off-diagonal blocks.
#ifndef PLANO_SRC_SUMO_SUMO_INTERNAL_HPP
#define PLANO_SRC_SUMO_SUMO_INTERNAL_HPP

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <vector>

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

    static Scope of(SumoBranch *b)
    {
        Scope s;
        s.branch = b;
        return s;
    }
    static Scope run(SumoStateVector *first, SumoStateVector *last)
    {
        Scope s;
        s.first = first;
        s.last = last;
        return s;
    }

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

// The set-up every state-range entry point shares: the optimiser present (the overload that
// takes one), the last state reachable from the first, the indices renumbered when
// `renumber`; *scope becomes the run. Failures are registered under `function`.
bool open_run(SumoStateVector *first, SumoStateVector *last, const char *function, Scope *scope);
bool open_run(Sumo *sumo, SumoStateVector *first, SumoStateVector *last, bool renumber, const char *function,
              Scope *scope);

// Walks of the eliminated list chase pointers through records scattered over the heap; each
// step requests what the next steps will read, one link further each: the record four states
// ahead, the first elimination-block list node three ahead, its block two ahead and that
// block's M_work one ahead.
inline void prefetch_eliminated(const SumoStateVector *e)
{
    const SumoStateVector *s1 = e->next;
    if (s1 == nullptr) return;
    if (const Plx_ListNode *n = s1->elim_blocks.head; n != nullptr && n->data != nullptr) {
        const auto *k = static_cast<const SumoOffdiag *>(n->data);
        for (std::size_t b = 0; b < sizeof(double) * k->M_work.rows * k->M_work.cols; b += 64)
            __builtin_prefetch(reinterpret_cast<const char *>(k->M_work.data) + b);
    }
    const SumoStateVector *s2 = s1->next;
    if (s2 == nullptr) return;
    if (const Plx_ListNode *n = s2->elim_blocks.head; n != nullptr) __builtin_prefetch(n->data);
    const SumoStateVector *s3 = s2->next;
    if (s3 == nullptr) return;
    __builtin_prefetch(s3->elim_blocks.head);
    __builtin_prefetch(s3->next);
}

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
// The same product for the small blocks of the information build, with fixed-size code for
// the common state dimensions (1, 2, 3, 4, 6, 8, 9): the k-term sums are formed first and
// added to C once. add_atb_sym adds the symmetric A^T B for A, B (k x n) whose product is
// symmetric (B = N' A): its lower triangle is added to both triangles, so C stays exactly
// symmetric.
void add_atb_block(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, uint32_t m, double *C);
void add_atb_sym(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, double *C);
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
// Workspaces kept in the Sumo for n threaded jobs; job j's is job_ws(base, j). Used records
// lie a cache line apart: jobs rewrite their workspace's sizes for every observation.
constexpr uint32_t kWorkspaceStride = sizeof(SumoWorkspace) >= 64 ? 2 : 1 + 64 / sizeof(SumoWorkspace);
SumoWorkspace *job_workspaces(Sumo *sumo, uint32_t n);
inline SumoWorkspace *job_ws(SumoWorkspace *base, uint32_t j) { return base + std::size_t(j) * kWorkspaceStride; }
void free_job_workspaces(Sumo *sumo);

// The last build of the root branch (see build_cache.cpp): taken after a build with index
// limits first..last, restored in place of the next one with the same limits when nothing it
// depends on changed (false: build as usual), dropped when something may have changed that
// its key does not show.
void build_cache_take(Sumo *sumo, uint32_t first, uint32_t last);
bool build_cache_restore(Sumo *sumo, uint32_t first, uint32_t last);
void build_cache_drop(Sumo *sumo);

// ---- solver internals shared between files ----

// Threaded passes give every job at least this much work (observations, or states for the
// parameter store); below it the jobs run one after another on the calling thread, since
// waking workers would cost more than the work. Each job still writes only its own
// accumulators, so the results are the same bits either way.
constexpr uint64_t kMinObsPerJob = 64;
constexpr uint64_t kMinStatesPerJob = 256;
// Where observations may be large (image blocks of thousands of rows), this many rows count
// as one observation's worth of work.
constexpr uint64_t kRowsPerObs = 16;
// The work of a whole-model pass in observation units: their count, or their rows when those
// weigh more.
inline uint64_t obs_work(const std::vector<SumoObs *> &obs)
{
    uint64_t rows = 0;
    for (const SumoObs *o : obs) rows += o->z.v.rows;
    return std::max<uint64_t>(obs.size(), rows / kRowsPerObs);
}
// Total costs add the observations in fixed chunks of this many, each chunk in list order and
// the chunk sums in chunk order, so that a cost has the same bits whatever the number of jobs.
constexpr uint32_t kCostChunk = 32;
inline const ThreadHostInterface *host_for(const ThreadHostInterface *host, uint64_t work, uint64_t min_per_job,
                                           uint32_t jobs)
{
    return work < min_per_job * jobs ? nullptr : host;
}

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
// With cost given (root, whole model, residual flag set), *cost receives the total cost at
// the parameters of the build, from the same evaluations.
bool build_scope(Sumo *sumo, const Scope &scope, uint32_t residual, uint32_t first, uint32_t last,
                 const ThreadHostInterface *host, const char *function, double *cost = nullptr);
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
// Makes the blocks of the observations the scope owns within [first, last] (first kAll: all
// of them; on the root, every active observation).
bool create_blocks_scope(Sumo *sumo, const Scope &scope, uint32_t first, uint32_t last);
// Makes the blocks between every pair of the observation's states with index in [first, last].
bool create_obs_blocks(Sumo *sumo, const SumoObs *obs, uint32_t first, uint32_t last);
// Appends the observations of a Sumo list whose states are all initialised, in list order
// (making their blocks when asked).
bool collect_counted(Sumo *sumo, SumoObs *head, bool make_blocks, std::vector<SumoObs *> &out);
// Called before evaluating obs[i] of n: the records lie scattered over the heap, so the
// record of obs[i + 4] and then the arrays of obs[i + 2] (its record fetched by now) are
// requested ahead.
inline void prefetch_obs(SumoObs *const *obs, uint32_t i, uint32_t n)
{
    if (i + 4 < n) {
        const char *r = reinterpret_cast<const char *>(obs[i + 4]);
        for (std::size_t line = 0; line < sizeof(SumoObs); line += 64) __builtin_prefetch(r + line);
    }
    if (i + 2 < n) {
        const SumoObs *o = obs[i + 2];
        __builtin_prefetch(o->states);
        __builtin_prefetch(o->z.v.data);
        __builtin_prefetch(o->N.data);
    }
}
double obs_cost(Sumo *sumo, SumoWorkspace *ws, SumoObs *obs, const char *function);
// Evaluates an observation into the workspace (prediction, wanted Jacobians, residual,
// effective information and chi-squared); see evaluate.cpp.
bool evaluate_obs(Sumo *sumo, SumoWorkspace *ws, SumoObs *o, bool residual, bool decide, bool jacobians,
                  uint32_t first, uint32_t last, double *chi2);
// bSumoObsEvaluate without the argument checks; *cost receives the observation's cost at
// the current parameters (0 without the residual flag).
bool accumulate_obs(Sumo *sumo, SumoWorkspace *ws, SumoObs *obs, uint32_t residual, uint32_t eliminate, uint32_t add,
                    uint32_t first, uint32_t last, uint32_t thread, double *cost);

}  // namespace sumo

#endif
