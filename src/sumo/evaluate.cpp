// Evaluating one observation: its prediction, Jacobians (from the function or by central
// differences), effective information matrix, robust decision, cost, and its contribution
// to the information blocks.
#include <cfloat>
#include <cmath>

#include "sumo/fused_kernels.hpp"
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

struct FusedPair {
    SumoHFunction h;
    FusedHKernel kernel;
};
constexpr uint32_t kMaxFused = 32;
// Written only while the library loads; read without locks afterwards.
FusedPair g_fused[kMaxFused];
uint32_t g_no_fused = 0;

bool is_h(const SumoObs *o) { return o->kind == SUMO_OBS_H || o->kind == SUMO_OBS_H_ROBUST; }
bool is_robust(const SumoObs *o) { return o->kind == SUMO_OBS_H_ROBUST || o->kind == SUMO_OBS_F_ROBUST; }

// Resizing rewrites the record's sizes; jobs evaluate thousands of observations of one
// shape, so the records are only touched when the shape changes.
bool fit_vec(Plx_Vector *v, uint32_t n) { return v->rows == n || plx_vec_resize(v, n); }
bool fit_mat(Plx_Matrix *M, uint32_t rows, uint32_t cols)
{
    return (M->rows == rows && M->cols == cols) || plx_mat_resize(M, rows, cols);
}
bool fit_squ(Plx_SquMatrix *A, Plx_SquMatrixType type, uint32_t n)
{
    return (A->type == type && A->size == n) || plx_squmat_resize(A, type, n);
}

bool call_function(Sumo *sumo, SumoWorkspace *ws, SumoObs *o, Plx_Vector *out, Plx_Matrix **jac, Plx_Matrix *Fz)
{
    const uint32_t m = o->z.v.rows;
    if (!fit_vec(out, m)) return false;
    if (is_h(o)) return o->func.h(sumo, ws, o->states, o->n_states, &o->z, out, jac) != 0;
    if (Fz != nullptr && !plx_mat_resize(Fz, m, m)) return false;
    return o->func.F(sumo, ws, o->states, o->n_states, &o->z, out, jac, Fz) != 0;
}

// Central differences of the wanted Jacobians; the function is called without Jacobians.
// The steps are taken on a private copy of the state (the observation's slot points at it
// meanwhile): other jobs may be evaluating observations of the same state at the same time,
// so the shared parameters are never written.
bool numeric_jacobians(Sumo *sumo, SumoWorkspace *ws, SumoObs *o)
{
    for (uint32_t i = 0; i < o->n_states; ++i) {
        Plx_Matrix *J = ws->jacobian_ptrs[i];
        if (J == nullptr) continue;
        SumoStateVector *s = o->states[i];
        const uint32_t n = dim(s);
        const double d = s->jacobian_step;
        if (!plx_mat_resize(&ws->mat, 1, n)) return false;
        SumoStateVector shadow = *s;
        shadow.x.v.data = ws->mat.data;
        std::memcpy(shadow.x.v.data, s->x.v.data, sizeof(double) * n);
        o->states[i] = &shadow;
        bool ok = true;
        for (uint32_t k = 0; ok && k < n; ++k) {
            double &xk = shadow.x.v.data[k];
            const double saved = xk;
            xk = saved - d;
            ok = call_function(sumo, ws, o, &ws->vec, nullptr, nullptr);
            xk = saved + d;
            ok = ok && call_function(sumo, ws, o, &ws->h, nullptr, nullptr);
            xk = saved;
            if (!ok) break;
            const uint32_t rows = ws->h.rows;
            if (ws->vec.rows != rows) {
                PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_INCOMPATIBLE, "function output size changed", rows);
                ok = false;
                break;
            }
            if (k == 0 && !plx_mat_resize(J, rows, n)) {
                ok = false;
                break;
            }
            const double inv = 1.0 / (2.0 * d);
            for (uint32_t r = 0; r < rows; ++r)
                J->data[std::size_t(r) * n + k] = (ws->h.data[r] - ws->vec.data[r]) * inv;
        }
        o->states[i] = s;
        if (!ok) return false;
    }
    return true;
}

// The effective information N' of an F-type: (Fz N Fz^T)^-1.
bool f_information(SumoWorkspace *ws, const SumoObs *o, uint32_t k)
{
    const uint32_t m = o->z.v.rows;
    if (ws->Fz.rows != k || ws->Fz.cols != m) {
        PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_INCOMPATIBLE, "dF/dz has the wrong size", ws->Fz.rows);
        return false;
    }
    if (!plx_squmat_resize(&ws->squ, PLX_SQUMAT_GENERIC, m) || !plx_mat_resize(&ws->mat, k, m) ||
        !plx_squmat_resize(&ws->N_eff, PLX_SQUMAT_SYMMETRIC, k))
        return false;
    squ_dense(&o->N, ws->squ.data);
    std::memset(ws->mat.data, 0, sizeof(double) * k * m);
    add_ab(1.0, ws->Fz.data, ws->squ.data, k, m, m, ws->mat.data);
    std::memset(ws->N_eff.data, 0, sizeof(double) * k * k);
    add_abt(1.0, ws->mat.data, ws->Fz.data, k, m, k, ws->N_eff.data);
    if (!chol(ws->N_eff.data, k)) {
        PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_ILLEGAL_ARGUMENT, "Fz N Fz^T is not positive definite", 0);
        return false;
    }
    if (!plx_squmat_resize(&ws->squ, PLX_SQUMAT_SYMMETRIC, k)) return false;
    chol_inverse(ws->N_eff.data, k, ws->squ.data);
    std::memcpy(ws->N_eff.data, ws->squ.data, sizeof(double) * k * k);
    return true;
}

// Information matrices that are diagonal (or a scaled identity) stay diagonal in the
// workspace (N_eff of type diagonal, k entries): the products with them are row scalings.
bool diagonal_type(Plx_SquMatrixType t) { return t == PLX_SQUMAT_DIAGONAL || t == PLX_SQUMAT_SCALED_IDENTITY; }

double quad_diag(const double *d, const double *r, uint32_t k)
{
    double q = 0.0;
    for (uint32_t i = 0; i < k; ++i) q += r[i] * (d[i] * r[i]);
    return q;
}

double quad(const double *N, const double *r, uint32_t k)
{
    double q = 0.0;
    for (uint32_t i = 0; i < k; ++i) {
        double s = 0.0;
        for (uint32_t j = 0; j < k; ++j) s += N[std::size_t(i) * k + j] * r[j];
        q += r[i] * s;
    }
    return q;
}

// Where an observation's information about state s goes: the fixed A and b when eliminating,
// a thread's accumulators inside a threaded build, else the work copies.
void info_target(SumoStateVector *s, uint32_t eliminate, uint32_t thread, double **A, double **b)
{
    if (eliminate) {
        *A = s->A.data;
        *b = s->b.data;
    } else if (thread != SUMO_NOT_IN_THREAD) {
        *A = s->thread_blocks[thread].A.data;
        *b = s->thread_blocks[thread].b.data;
    } else {
        *A = s->A_work.data;
        *b = s->b_work.data;
    }
}

// The same for the block between s and t (*s_row: s is the block's row state).
bool offdiag_target(Sumo *sumo, SumoStateVector *s, SumoStateVector *t, uint32_t eliminate, uint32_t thread,
                    double **M, bool *s_row)
{
    SumoOffdiag *blk;
    if (!block_between(sumo, s, t, thread == SUMO_NOT_IN_THREAD, &blk, s_row)) return false;
    if (blk == nullptr) {
        PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_NOT_INITIALISED,
                         "off-diagonal block not made before a threaded build", 0);
        return false;
    }
    *M = eliminate ? blk->M.data : (thread != SUMO_NOT_IN_THREAD ? blk->thread_blocks[thread].data : blk->M_work.data);
    return true;
}

// The cost of an evaluated observation from its chi-squared and decision.
double cost_of(const SumoObs *o, double chi2)
{
    if (!is_robust(o) || !o->outlier) return chi2 * o->weight;
    return (chi2 / o->variance_scaling + o->chi2_offset) * o->weight;
}

// The kernel to use for o, or null for the general path.
FusedHKernel fused_kernel_of(const SumoObs *o)
{
    if (!is_h(o) || o->numeric_jacobians || !diagonal_type(o->N.type)) return nullptr;
    return fused_h(o->func.h);
}

// Chi-squared (and the terms, when asked) from a fused kernel; sizes as the general path
// checks them.
FusedResult fused_chi2(FusedHKernel kernel, SumoObs *o, double *chi2, double *jtnj, double *jtnr)
{
    const uint32_t step = o->N.type == PLX_SQUMAT_DIAGONAL ? 1u : 0u;
    if (step == 1 && o->N.size != o->z.v.rows) {
        PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_INCOMPATIBLE, "information matrix size", o->N.size);
        return FusedResult::failed;
    }
    const FusedResult r = kernel(o->states, o->n_states, &o->z, o->N.data, step, chi2, jtnj, jtnr);
    if (r == FusedResult::failed)
        plx_err_register_fileline("bSumoObsEvaluate", PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
    return r;
}

// The kernel's terms of a fused observation with Jacobians for [first, last]; declined when
// the observation is too large for the fixed arrays.
FusedResult fused_terms(FusedHKernel kernel, SumoObs *obs, uint32_t first, uint32_t last, FusedTerms *t)
{
    if (obs->n_states > 8) return FusedResult::declined;
    t->n_total = 0;
    t->any = false;
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        SumoStateVector *s = obs->states[i];
        t->offset[i] = t->n_total;
        t->n_total += s != nullptr ? dim(s) : 0;
        t->want[i] = s != nullptr && is_active(s) && dim(s) > 0 &&
                     (first == kAll || (s->index >= first && s->index <= last));
        t->any = t->any || t->want[i];
    }
    if (t->n_total > kFusedMaxParams) return FusedResult::declined;
    t->chi2 = 0.0;
    return fused_chi2(kernel, obs, &t->chi2, t->any ? t->jtnj : nullptr, t->jtnr);
}

// The terms computed ahead for this observation and these limits, or null.
const FusedTerms *terms_ahead(const Sumo *sumo, const SumoObs *obs, uint32_t first, uint32_t last)
{
    const auto *ahead = static_cast<const FusedAhead *>(sumo->fused_ahead);
    if (ahead == nullptr || ahead->first != first || ahead->last != last) return nullptr;
    const auto it = ahead->index.find(obs);
    return it != ahead->index.end() && ahead->done[it->second] ? &ahead->terms[it->second] : nullptr;
}

// accumulate_obs through a fused kernel: the same decisions, costs and destinations as the
// general path, with the terms taken from the kernel's stacked J^T N J and J^T N r.
FusedResult accumulate_fused(Sumo *sumo, FusedHKernel kernel, SumoObs *obs, uint32_t residual, uint32_t eliminate,
                             uint32_t add, uint32_t first, uint32_t last, uint32_t thread, double *cost)
{
    constexpr FusedResult failed = FusedResult::failed;
    FusedTerms local;
    const FusedTerms *t = terms_ahead(sumo, obs, first, last);
    if (t == nullptr) {
        const FusedResult r = fused_terms(kernel, obs, first, last, &local);
        if (r != FusedResult::done) return r;
        t = &local;
    }
    *cost = 0.0;
    if (residual) {
        if (!std::isfinite(t->chi2)) {
            PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_OUTSIDE_RANGE, "residual is not finite", 0);
            return failed;
        }
        if (is_robust(obs)) obs->outlier = t->chi2 > obs->chi2_cutoff ? 1u : 0u;
        *cost = cost_of(obs, t->chi2);
    }
    if (!t->any) return FusedResult::done;
    const uint32_t n_total = t->n_total;
    const double *jtnj = t->jtnj, *jtnr = t->jtnr;
    double alpha = (add ? 1.0 : -1.0) * obs->weight;
    if (is_robust(obs) && obs->outlier) alpha *= 1.0 / obs->variance_scaling;
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        if (!t->want[i]) continue;
        SumoStateVector *s = obs->states[i];
        const uint32_t n = dim(s), oi = t->offset[i];
        double *A, *b;
        info_target(s, eliminate, thread, &A, &b);
        for (uint32_t r = 0; r < n; ++r) {
            const double *src = jtnj + std::size_t(oi + r) * n_total + oi;
            double *dst = A + std::size_t(r) * n;
            for (uint32_t c = 0; c < n; ++c) dst[c] += alpha * src[c];
            if (residual) b[r] += alpha * jtnr[oi + r];
        }
        for (uint32_t j = i + 1; j < obs->n_states; ++j) {
            if (!t->want[j]) continue;
            double *M;
            bool i_row;
            if (!offdiag_target(sumo, s, obs->states[j], eliminate, thread, &M, &i_row)) return failed;
            // The row state's rows of the stacked matrix, the column state's columns.
            const uint32_t row = i_row ? oi : t->offset[j], col = i_row ? t->offset[j] : oi;
            const uint32_t rows = i_row ? n : dim(obs->states[j]), cols = i_row ? dim(obs->states[j]) : n;
            for (uint32_t r = 0; r < rows; ++r) {
                const double *src = jtnj + std::size_t(row + r) * n_total + col;
                double *dst = M + std::size_t(r) * cols;
                for (uint32_t c = 0; c < cols; ++c) dst[c] += alpha * src[c];
            }
        }
    }
    return FusedResult::done;
}

}  // namespace

namespace sumo {

bool has_fused_kernel(const SumoObs *obs) { return obs->kind <= SUMO_OBS_F_ROBUST && fused_kernel_of(obs) != nullptr; }

bool fused_terms_of(SumoObs *obs, uint32_t first, uint32_t last, FusedTerms *terms)
{
    return has_fused_kernel(obs) && fused_terms(fused_kernel_of(obs), obs, first, last, terms) == FusedResult::done;
}

bool register_fused_h(SumoHFunction h, FusedHKernel kernel)
{
    if (h == nullptr || kernel == nullptr || g_no_fused == kMaxFused) return false;
    g_fused[g_no_fused++] = FusedPair{h, kernel};
    return true;
}

FusedHKernel fused_h(SumoHFunction h)
{
    for (uint32_t i = 0; i < g_no_fused; ++i)
        if (g_fused[i].h == h) return g_fused[i].kernel;
    return nullptr;
}

// Evaluates the observation into the workspace: jacobian_ptrs (null when unwanted), h,
// residual (when asked), N_eff and chi-squared. With `decide`, robust kinds take a new
// decision from chi-squared; otherwise the stored decision applies. N_eff is scaled for
// outliers. Jacobians are wanted for active states of nonzero dimension whose index lies in
// [first, last] (first kAll: all) when `jacobians` is set.
bool evaluate_obs(Sumo *sumo, SumoWorkspace *ws, SumoObs *o, bool residual, bool decide, bool jacobians,
                  uint32_t first, uint32_t last, double *chi2)
{
    if (o->kind > SUMO_OBS_F_ROBUST) {
        PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_ILLEGAL_TYPE, "unknown observation kind", o->kind);
        return false;
    }
    if (!workspace_grow(ws, o->n_states)) return false;
    const uint32_t m = o->z.v.rows;
    bool any = false;
    for (uint32_t i = 0; i < o->n_states; ++i) {
        SumoStateVector *s = o->states[i];
        const bool want = jacobians && s != nullptr && is_active(s) && dim(s) > 0 &&
                          (first == kAll || (s->index >= first && s->index <= last));
        ws->jacobian_ptrs[i] = want ? &ws->jacobians[i] : nullptr;
        if (want) {
            any = true;
            if (!fit_mat(&ws->jacobians[i], m, dim(s))) return false;
            std::memset(ws->jacobians[i].data, 0, sizeof(double) * m * dim(s));
        }
    }
    const bool numeric = any && o->numeric_jacobians;
    if (numeric && !numeric_jacobians(sumo, ws, o)) return false;
    Plx_Matrix **jac = (any && !numeric) ? ws->jacobian_ptrs : nullptr;
    if (!call_function(sumo, ws, o, &ws->h, jac, is_h(o) ? nullptr : &ws->Fz)) return false;
    const uint32_t k = ws->h.rows;
    if (is_h(o) && k != m) {
        PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_INCOMPATIBLE, "h has the wrong size", k);
        return false;
    }
    for (uint32_t i = 0; i < o->n_states; ++i) {
        const Plx_Matrix *J = ws->jacobian_ptrs[i];
        if (J != nullptr && (J->rows != k || J->cols != dim(o->states[i]))) {
            PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_INCOMPATIBLE, "Jacobian has the wrong size", J->rows);
            return false;
        }
    }
    if (is_h(o) && diagonal_type(o->N.type)) {
        if (!fit_squ(&ws->N_eff, PLX_SQUMAT_DIAGONAL, k)) return false;
        for (uint32_t r = 0; r < k; ++r) ws->N_eff.data[r] = o->N.data[o->N.type == PLX_SQUMAT_DIAGONAL ? r : 0];
    } else if (is_h(o)) {
        if (!fit_squ(&ws->N_eff, PLX_SQUMAT_SYMMETRIC, k)) return false;
        squ_dense(&o->N, ws->N_eff.data);
    } else if (!f_information(ws, o, k)) {
        return false;
    }
    const bool diagonal = ws->N_eff.type == PLX_SQUMAT_DIAGONAL;
    *chi2 = 0.0;
    if (residual) {
        if (!fit_vec(&ws->residual, k)) return false;
        for (uint32_t r = 0; r < k; ++r)
            ws->residual.data[r] = is_h(o) ? o->z.v.data[r] - ws->h.data[r] : -ws->h.data[r];
        *chi2 = diagonal ? quad_diag(ws->N_eff.data, ws->residual.data, k) : quad(ws->N_eff.data, ws->residual.data, k);
        if (!std::isfinite(*chi2)) {
            PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_OUTSIDE_RANGE, "residual is not finite", 0);
            return false;
        }
        if (decide && is_robust(o)) o->outlier = *chi2 > o->chi2_cutoff ? 1u : 0u;
    }
    if (is_robust(o) && o->outlier) {
        const double inv = 1.0 / o->variance_scaling;
        const std::size_t stored = diagonal ? k : std::size_t(k) * k;
        for (std::size_t i = 0; i < stored; ++i) ws->N_eff.data[i] *= inv;
    }
    return true;
}

double obs_cost(Sumo *sumo, SumoWorkspace *ws, SumoObs *o, const char *function)
{
    double chi2;
    const FusedHKernel kernel = fused_kernel_of(o);
    FusedResult r = kernel != nullptr ? fused_chi2(kernel, o, &chi2, nullptr, nullptr) : FusedResult::declined;
    if (r == FusedResult::done && !std::isfinite(chi2)) {
        PLX_ERR_START_AS("bSumoObsEvaluate", PLX_ERROR_OUTSIDE_RANGE, "residual is not finite", 0);
        r = FusedResult::failed;
    }
    if (r == FusedResult::declined)
        r = evaluate_obs(sumo, ws, o, true, false, false, kAll, kAll, &chi2) ? FusedResult::done : FusedResult::failed;
    if (r == FusedResult::failed) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return SUMO_FAILED_RESIDUAL;
    }
    // chi2 is always r^T N' r with the unscaled N'.
    if (is_robust(o)) o->outlier = chi2 <= o->chi2_cutoff ? 0u : 1u;
    return cost_of(o, chi2);
}

bool accumulate_obs(Sumo *sumo, SumoWorkspace *ws, SumoObs *obs, uint32_t residual, uint32_t eliminate, uint32_t add,
                    uint32_t first, uint32_t last, uint32_t thread, double *cost)
{
    if (obs->kind <= SUMO_OBS_F_ROBUST)
        if (const FusedHKernel kernel = fused_kernel_of(obs)) {
            const FusedResult r = accumulate_fused(sumo, kernel, obs, residual, eliminate, add, first, last, thread, cost);
            if (r != FusedResult::declined) return r == FusedResult::done;
        }
    double chi2;
    if (!evaluate_obs(sumo, ws, obs, residual != 0, residual != 0, true, first, last, &chi2)) return false;
    *cost = residual ? cost_of(obs, chi2) : 0.0;
    const uint32_t k = ws->h.rows;
    const bool diagonal = ws->N_eff.type == PLX_SQUMAT_DIAGONAL;
    const double alpha = (add ? 1.0 : -1.0) * obs->weight;
    // N' J_i for every state with a Jacobian.
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        const Plx_Matrix *J = ws->jacobian_ptrs[i];
        if (J == nullptr) continue;
        const uint32_t n = J->cols;
        if (!fit_mat(&ws->nj[i], k, n)) return false;
        double *nj = ws->nj[i].data;
        if (diagonal) {
            for (uint32_t r = 0; r < k; ++r) {
                const double d = ws->N_eff.data[r];
                for (uint32_t c = 0; c < n; ++c) nj[std::size_t(r) * n + c] = d * J->data[std::size_t(r) * n + c];
            }
        } else {
            std::memset(nj, 0, sizeof(double) * k * n);
            add_ab(1.0, ws->N_eff.data, J->data, k, k, n, nj);
        }
    }
    for (uint32_t i = 0; i < obs->n_states; ++i) {
        const Plx_Matrix *Ji = ws->jacobian_ptrs[i];
        if (Ji == nullptr) continue;
        SumoStateVector *s = obs->states[i];
        const uint32_t n = Ji->cols;
        double *A, *b;
        info_target(s, eliminate, thread, &A, &b);
        add_atb_sym(alpha, Ji->data, ws->nj[i].data, k, n, A);
        if (residual) add_atv(alpha, ws->nj[i].data, ws->residual.data, k, n, b);
        for (uint32_t j = i + 1; j < obs->n_states; ++j) {
            const Plx_Matrix *Jj = ws->jacobian_ptrs[j];
            if (Jj == nullptr) continue;
            double *M;
            bool i_row;
            if (!offdiag_target(sumo, s, obs->states[j], eliminate, thread, &M, &i_row)) return false;
            if (i_row)
                add_atb_block(alpha, Ji->data, ws->nj[j].data, k, n, Jj->cols, M);
            else
                add_atb_block(alpha, Jj->data, ws->nj[i].data, k, Jj->cols, n, M);
        }
    }
    return true;
}

}  // namespace sumo

extern "C" {

PLANO_API Plx_Bool bSumoObsEvaluate(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs, uint32_t residual,
                                    uint32_t eliminate, uint32_t add, uint32_t first, uint32_t last, uint32_t thread)
{
    if (sumo == nullptr || workspace == nullptr || obs == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (thread != SUMO_NOT_IN_THREAD && thread >= sumo->n_threads) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "thread index beyond the thread count", thread);
        return PLX_FALSE;
    }
    if (thread == SUMO_NOT_IN_THREAD && !ensure_indices(sumo)) return PLX_FALSE;
    double cost;
    if (!accumulate_obs(sumo, workspace, obs, residual, eliminate, add, first, last, thread, &cost)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API double dSumoObsComputeResidual(Sumo *sumo, SumoWorkspace *workspace, SumoObs *obs)
{
    if (sumo == nullptr || workspace == nullptr || obs == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return SUMO_FAILED_RESIDUAL;
    }
    return obs_cost(sumo, workspace, obs, __func__);
}

}  // extern "C"
