// Recursive block Cholesky elimination, back substitution and covariances.
//
// With H the block information matrix in elimination order, the factor U (H = U^T U) has
// diagonal blocks L_S^T and off-diagonal blocks W_SC = L_S^-1 M_SC. Eliminating S factors
// its (updated) diagonal block, forward-solves its vector, turns its row blocks into W_SC,
// and subtracts W_SC^T W_SD from the blocks of every pair of later neighbours (fill-in).
// Back substitution solves U delta = y in reverse order. Covariances follow the same reverse
// order: with V_SC = L_S^-T W_SC,
//   Sigma_SC = -sum_C' V_SC' Sigma_C'C,   Sigma_SS = (L L^T)^-1 - sum_C Sigma_SC V_SC^T,
// where every Sigma_C'C is already known because the neighbours of S form a clique after
// fill-in and come later in the order.
#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

bool in_last(const SumoStateVector *s, uint32_t last) { return last == kAll || s->index <= last; }

bool all_zero(const Plx_Matrix &m)
{
    const std::size_t n = std::size_t(m.rows) * m.cols;
    for (std::size_t i = 0; i < n; ++i)
        if (m.data[i] != 0.0) return false;
    return true;
}

// Sigma between two neighbours a and b of a state, added into out (n x dim b) as
// out += alpha V_a Sigma_ab for V_a (n x dim a). False when a needed covariance is missing.
bool add_v_sigma(double alpha, const double *Va, uint32_t n, SumoStateVector *a, SumoStateVector *b, double *out,
                 bool *missing)
{
    const uint32_t da = dim(a), db = dim(b);
    if (a == b) {
        if (!a->covariance_valid) return false;
        add_ab(alpha, Va, a->covariance.data, n, da, db, out);
        return true;
    }
    SumoOffdiag *k = find_any_block(a, b);
    if (k == nullptr) {
        *missing = true;  // no coupling was kept (elimination without fill-in): taken as zero
        return true;
    }
    if (!k->row->covariance_valid) return false;
    if (k->row == a)
        add_ab(alpha, Va, k->M_cov.data, n, da, db, out);
    else
        add_abt(alpha, Va, k->M_cov.data, n, da, db, out);
    return true;
}

}  // namespace

namespace sumo {

bool eliminate_scope(const Scope &scope, Sumo *sumo, uint32_t solve, uint32_t last, int32_t *error_code,
                     const char *function)
{
    bool factor_failed = false;
    const bool ok = scope.walk([&](SumoStateVector *s) {
        if (!is_active(s) || !in_last(s, last)) return true;
        const uint32_t n = dim(s);
        if (n == 0) return true;
        double *L = s->A_work.data;
        if (!chol(L, n)) {
            factor_failed = true;
            return false;
        }
        s->A_work.type = PLX_SQUMAT_LOWER_TRIANGULAR;
        if (solve) fwd_v(L, n, s->b_work.data);
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            if (!in_last(k->col, last)) continue;
            fwd_m(L, n, k->M_work.data, k->M_work.cols);
            if (solve) add_atv(-1.0, k->M_work.data, s->b_work.data, n, k->M_work.cols, k->col->b_work.data);
        }
        for (SumoOffdiag *kc = s->row_blocks; kc != nullptr; kc = kc->row_next) {
            if (!in_last(kc->col, last) || all_zero(kc->M_work)) continue;
            SumoStateVector *C = kc->col;
            const uint32_t dc = dim(C);
            add_atb(-1.0, kc->M_work.data, kc->M_work.data, n, dc, dc, C->A_work.data);
            for (SumoOffdiag *kd = kc->row_next; kd != nullptr; kd = kd->row_next) {
                if (!in_last(kd->col, last) || all_zero(kd->M_work)) continue;
                SumoStateVector *D = kd->col;
                SumoOffdiag *fill;
                bool c_row;
                if (!block_between(sumo, C, D, true, &fill, &c_row)) return false;
                if (c_row)
                    add_atb(-1.0, kc->M_work.data, kd->M_work.data, n, dc, dim(D), fill->M_work.data);
                else
                    add_atb(-1.0, kd->M_work.data, kc->M_work.data, n, dim(D), dc, fill->M_work.data);
            }
        }
        return true;
    });
    if (ok) return true;
    if (factor_failed && error_code != nullptr) {
        *error_code = PLX_ERROR_ILLEGAL_ARGUMENT;
        return false;
    }
    if (factor_failed)
        PLX_ERR_START_AS(function, PLX_ERROR_CALLEE, "information block is not positive definite", 0);
    else
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
    return false;
}

bool back_substitute_scope(Sumo *sumo, const Scope &scope, SumoStateVector *target, uint32_t apply, uint32_t first,
                           uint32_t last)
{
    (void)sumo;
    const uint32_t lo = first == kAll ? 0 : first;
    bool reached = false, missing_cov = false;
    // Covariances from an earlier solve are stale once this pass starts.
    scope.walk([&](SumoStateVector *s) {
        if (is_active(s) && in_last(s, last) && s->index >= lo) s->covariance_valid = 0;
        return true;
    });
    const bool ok = scope.walk_reverse([&](SumoStateVector *s) {
        if (reached) return true;
        if (!is_active(s) || !in_last(s, last) || s->index < lo) return true;
        const uint32_t n = dim(s);
        const double *L = s->A_work.data;
        if (apply) {
            if (n == 0) return true;
            bwd_v(L, n, s->b_work.data);
            for (SumoOffdiag *k = s->col_blocks; k != nullptr; k = k->col_next) {
                if (!is_active(k->row) || k->row->index < lo) continue;
                add_av(-1.0, k->M_work.data, s->b_work.data, dim(k->row), n, k->row->b_work.data);
            }
            return true;
        }
        // Covariances.
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next)
            if (in_last(k->col, last)) bwd_m(L, n, k->M_work.data, k->M_work.cols);
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            if (!in_last(k->col, last)) continue;
            std::memset(k->M_cov.data, 0, sizeof(double) * k->M_cov.rows * k->M_cov.cols);
            for (SumoOffdiag *k2 = s->row_blocks; k2 != nullptr; k2 = k2->row_next) {
                if (!in_last(k2->col, last)) continue;
                bool missing = false;
                if (!add_v_sigma(-1.0, k2->M_work.data, n, k2->col, k->col, k->M_cov.data, &missing)) {
                    missing_cov = true;
                    return false;
                }
            }
        }
        s->covariance.type = PLX_SQUMAT_SYMMETRIC;
        if (n > 0) chol_inverse(L, n, s->covariance.data);
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next)
            if (in_last(k->col, last)) add_abt(-1.0, k->M_cov.data, k->M_work.data, n, k->M_cov.cols, n, s->covariance.data);
        s->covariance_valid = 1;
        if (s == target) reached = true;
        return true;
    });
    if (!ok && missing_cov) {
        PLX_ERR_START_AS("bBackSubstitution", PLX_ERROR_NOT_INITIALISED, "covariance of a later state missing", 0);
        return false;
    }
    return ok;
}

void init_elim_state_covariance(Sumo *sumo, SumoStateVector *target, bool covariance_mode)
{
    (void)target;
    for (SumoStateVector *e = sumo->elim_last; e != nullptr; e = e->next) {
        if (e->next != nullptr) __builtin_prefetch(e->next->next);
        e->covariance_valid = 0;
        if (!covariance_mode) continue;
        for (SumoOffdiag *k = e->row_blocks; k != nullptr; k = k->row_next)
            std::memset(k->M_cov.data, 0, sizeof(double) * k->M_cov.rows * k->M_cov.cols);
    }
}

bool compute_elim_state_covariance(Sumo *sumo, SumoStateVector *target)
{
    for (SumoStateVector *e = sumo->elim_last; e != nullptr; e = e->next) {
        const uint32_t n = dim(e);
        for (SumoOffdiag *k = e->row_blocks; k != nullptr; k = k->row_next) {
            std::memset(k->M_cov.data, 0, sizeof(double) * k->M_cov.rows * k->M_cov.cols);
            for (SumoOffdiag *k2 = e->row_blocks; k2 != nullptr; k2 = k2->row_next) {
                bool missing = false;
                if (!add_v_sigma(-1.0, k2->M_work.data, n, k2->col, k->col, k->M_cov.data, &missing)) {
                    PLX_ERR_START_AS("bComputeElimStateCovariance", PLX_ERROR_NOT_INITIALISED,
                                     "covariance of a neighbour missing", 0);
                    return false;
                }
            }
        }
        // A_work has held A^-1 since the elimination.
        std::memcpy(e->covariance.data, e->A_work.data, sizeof(double) * n * n);
        e->covariance.type = PLX_SQUMAT_SYMMETRIC;
        for (SumoOffdiag *k = e->row_blocks; k != nullptr; k = k->row_next)
            add_abt(-1.0, k->M_cov.data, k->M_work.data, n, k->M_cov.cols, n, e->covariance.data);
        e->covariance_valid = 1;
        if (e == target) break;
    }
    return true;
}

}  // namespace sumo

extern "C" {

PLANO_API Plx_Bool bRecursiveEliminationBranch(Sumo *sumo, SumoBranch *branch, uint32_t solve, double lambda,
                                               uint32_t mode, uint32_t last, int32_t *error_code)
{
    (void)lambda;
    (void)mode;
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (!ensure_indices(sumo)) return PLX_FALSE;
    Scope scope;
    scope.branch = branch;
    return eliminate_scope(scope, sumo, solve, last, error_code, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bRecursiveEliminationStateRange(Sumo *sumo, SumoStateVector *first_state,
                                                   SumoStateVector *last_state, uint32_t solve, double lambda,
                                                   uint32_t mode, uint32_t last, int32_t *error_code)
{
    (void)lambda;
    (void)mode;
    Scope scope;
    if (!open_run(sumo, first_state, last_state, true, __func__, &scope)) return PLX_FALSE;
    return eliminate_scope(scope, sumo, solve, last, error_code, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLANO_API Plx_Bool bBackSubstitutionBranch(Sumo *sumo, SumoBranch *branch, SumoStateVector *target, uint32_t apply,
                                           uint32_t first, uint32_t last)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    Scope scope;
    scope.branch = branch;
    if (!back_substitute_scope(sumo, scope, target, apply, first, last)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bBackSubstitutionStateRange(Sumo *sumo, SumoStateVector *first_state, SumoStateVector *last_state,
                                               SumoStateVector *target, uint32_t apply, uint32_t first, uint32_t last)
{
    Scope scope;
    if (!open_run(sumo, first_state, last_state, false, __func__, &scope)) return PLX_FALSE;
    if (!back_substitute_scope(sumo, scope, target, apply, first, last)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

}  // extern "C"
