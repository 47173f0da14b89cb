// Gauss-Seidel and SOR relaxation: an iterative alternative to elimination that solves
// H delta = b one state at a time, each diagonal block factored once. The adjustment of
// each state lives in its x_old while relaxing.
#include <vector>

#include "sumo/sumo_internal.hpp"

using namespace sumo;

namespace {

struct Bounds {
    uint32_t lo = kAll, hi = kAll;
    bool contains(const SumoStateVector *s) const
    {
        return is_active(s) && (lo == kAll || (s->index >= lo && s->index <= hi));
    }
};

Bounds bounds_of(Sumo *sumo, SumoBranch *branch)
{
    Bounds b;
    if (branch != sumo->root) bSumoGetIndexLimitsBranch(branch, &b.lo, &b.hi);
    return b;
}

// t = b_work - sum of the off-diagonal blocks times the neighbours' adjustments.
void off_diagonal_rhs(const SumoStateVector *s, const Bounds &in, double *t)
{
    const uint32_t n = dim(s);
    std::memcpy(t, s->b_work.data, sizeof(double) * n);
    for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next)
        if (in.contains(k->col)) add_av(-1.0, k->M_work.data, k->col->x_old.data, n, dim(k->col), t);
    for (SumoOffdiag *k = s->col_blocks; k != nullptr; k = k->col_next)
        if (in.contains(k->row)) add_atv(-1.0, k->M_work.data, k->row->x_old.data, dim(k->row), n, t);
}

template <class Update>
bool sweep(Sumo *sumo, SumoBranch *branch, Update &&update, const char *function)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return false;
    }
    const Bounds in = bounds_of(sumo, branch);
    try {
        std::vector<double> t;
        Scope scope;
        scope.branch = branch;
        return scope.walk([&](SumoStateVector *s) {
            if (!in.contains(s) || dim(s) == 0) return true;
            t.resize(dim(s));
            off_diagonal_rhs(s, in, t.data());
            update(s, t.data());
            if (s->adjust_func != nullptr && !s->adjust_func(sumo, 0, s)) {
                PLX_ERR_START_AS(function, PLX_ERROR_CALLEE, "adjust function failed", 0);
                return false;
            }
            return true;
        });
    } catch (const std::bad_alloc &) {
        PLX_ERR_START_AS(function, PLX_ERROR_MALLOC_FAILED, "relaxation vector", 0);
        return false;
    }
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoRelaxationInitBranch(Sumo *sumo, SumoBranch *branch, uint32_t first, uint32_t last,
                                             const ThreadHostInterface *host)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    Scope scope;
    scope.branch = branch;
    scope.walk([](SumoStateVector *s) {
        if (is_active(s) && dim(s) > 0) std::memset(s->x_old.data, 0, sizeof(double) * dim(s));
        return true;
    });
    if (!build_scope(sumo, scope, 1, first, last, host, __func__)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    const Bounds in = bounds_of(sumo, branch);
    const bool ok = scope.walk([&](SumoStateVector *s) {
        if (!in.contains(s)) return true;
        if (!chol(s->A_work.data, dim(s))) return false;
        s->A_work.type = PLX_SQUMAT_LOWER_TRIANGULAR;
        return true;
    });
    if (!ok) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "information block is not positive definite", 0);
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoGaussSeidelIterationBranch(Sumo *sumo)
{
    if (sumo == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    return sweep(
               sumo, sumo->root,
               [](SumoStateVector *s, double *t) {
                   const uint32_t n = dim(s);
                   fwd_v(s->A_work.data, n, t);
                   bwd_v(s->A_work.data, n, t);
                   std::memcpy(s->x_old.data, t, sizeof(double) * n);
               },
               __func__)
               ? PLX_TRUE
               : PLX_FALSE;
}

PLANO_API Plx_Bool bSumoSORIterationBranch(Sumo *sumo, SumoBranch *branch, double omega)
{
    return sweep(
               sumo, branch,
               [omega](SumoStateVector *s, double *t) {
                   const uint32_t n = dim(s);
                   add_llt_v(-1.0, s->A_work.data, s->x_old.data, n, t);
                   fwd_v(s->A_work.data, n, t);
                   bwd_v(s->A_work.data, n, t);
                   for (uint32_t i = 0; i < n; ++i) s->x_old.data[i] += omega * t[i];
               },
               __func__)
               ? PLX_TRUE
               : PLX_FALSE;
}

PLANO_API double dSumoRelaxationResidualBranch(Sumo *sumo, SumoBranch *branch)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return SUMO_FAILED_RESIDUAL;
    }
    const Bounds in = bounds_of(sumo, branch);
    double sum = 0.0;
    try {
        std::vector<double> t;
        Scope scope;
        scope.branch = branch;
        scope.walk([&](SumoStateVector *s) {
            if (!in.contains(s) || dim(s) == 0) return true;
            t.resize(dim(s));
            off_diagonal_rhs(s, in, t.data());
            add_llt_v(-1.0, s->A_work.data, s->x_old.data, dim(s), t.data());
            for (double v : t) sum += v * v;
            return true;
        });
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "relaxation vector", 0);
        return SUMO_FAILED_RESIDUAL;
    }
    return sum;
}

PLANO_API Plx_Bool bSumoRelaxationFinishBranch(Sumo *sumo, SumoBranch *branch, const ThreadHostInterface *host)
{
    if (sumo == nullptr || branch == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    const Bounds in = bounds_of(sumo, branch);
    Scope scope;
    scope.branch = branch;
    const bool ok = scope.walk([&](SumoStateVector *s) {
        if (!in.contains(s)) return true;
        add_into(s->x.v.data, s->x_old.data, dim(s));
        return s->adjust_func == nullptr || s->adjust_func(sumo, 0, s) != 0;
    });
    if (!ok) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "adjust function failed", 0);
        return PLX_FALSE;
    }
    const double c = dSumoComputeResidualBranch(sumo, branch, host);
    if (c == SUMO_FAILED_RESIDUAL) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    sumo->residual = c;
    sumo->cache_branch = branch;
    sumo->cache_first = sumo->cache_last = nullptr;
    sumo->modified = 0;
    build_cache_drop(sumo);
    return PLX_TRUE;
}

}  // extern "C"
