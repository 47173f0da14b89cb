// Shared pieces of the optimiser tests: owning wrappers, small observation functions and a
// dense Gauss-Newton reference built plainly with Eigen from the model's observations.
#ifndef PLANO_TESTS_SUMO_TEST_UTIL_HPP
#define PLANO_TESTS_SUMO_TEST_UTIL_HPP

#include <Eigen/Dense>
#include <cmath>
#include <map>
#include <memory>
#include <vector>

#include <gtest/gtest.h>

#include "failure_check.hpp"

#include "plano/plano.h"
#include "plano_host/host.h"

namespace sumo_test {

using plano_test::fails_with;

struct SumoDeleter {
    void operator()(Sumo *s) const { vSumoFree(s, nullptr); }
};
using SumoPtr = std::unique_ptr<Sumo, SumoDeleter>;

struct WorkspaceDeleter {
    void operator()(SumoWorkspace *w) const { vSumoWorkspaceFree(w); }
};
using WorkspacePtr = std::unique_ptr<SumoWorkspace, WorkspaceDeleter>;

struct HostDeleter {
    void operator()(PlanoHost *h) const { plano_host_free(h); }
};
using HostPtr = std::unique_ptr<PlanoHost, HostDeleter>;

// One iteration over the whole model: lambda 0 is a Gauss-Newton step, apply 0 computes the
// covariances instead of moving the parameters.
inline bool iterate(Sumo *sumo, double lambda = 0.0, uint32_t *accepted = nullptr, double *reduction = nullptr,
                    const ThreadHostInterface *host = nullptr, uint32_t mode = 0, uint32_t apply = 1)
{
    return bSumoLevMarqIterationBranchGen(sumo, sumo->root, nullptr, apply, lambda, mode, 0xFFFFFFFFu, 0xFFFFFFFFu,
                                          accepted, reduction, host) != 0;
}

inline int32_t error_code()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.code : 0;
}


// A vector owning its numbers.
struct Vec {
    Plx_Vector v{};
    explicit Vec(std::initializer_list<double> values)
    {
        plx_vec_form(&v, uint32_t(values.size()));
        uint32_t i = 0;
        for (double x : values) v.data[i++] = x;
    }
    explicit Vec(const Eigen::VectorXd &e)
    {
        plx_vec_form(&v, uint32_t(e.size()));
        for (int i = 0; i < e.size(); ++i) v.data[i] = e[i];
    }
    ~Vec() { plx_vec_free(&v); }
    Vec(const Vec &) = delete;
    Vec &operator=(const Vec &) = delete;
};

// A scaled identity, diagonal or full symmetric information matrix.
struct Squ {
    Plx_SquMatrix m{};
    Squ(uint32_t n, double s)
    {
        plx_squmat_form(&m, PLX_SQUMAT_SCALED_IDENTITY, n);
        m.data[0] = s;
    }
    explicit Squ(const Eigen::MatrixXd &e)
    {
        plx_squmat_form(&m, PLX_SQUMAT_SYMMETRIC, uint32_t(e.rows()));
        for (int i = 0; i < e.rows(); ++i)
            for (int j = 0; j < e.cols(); ++j) m.data[i * e.cols() + j] = e(i, j);
    }
    ~Squ() { plx_squmat_free(&m); }
    Squ(const Squ &) = delete;
    Squ &operator=(const Squ &) = delete;
};

inline Eigen::VectorXd params(const SumoStateVector *s)
{
    Eigen::VectorXd x(s->x.v.rows);
    for (uint32_t i = 0; i < s->x.v.rows; ++i) x[i] = s->x.v.data[i];
    return x;
}

inline void set_params(SumoStateVector *s, const Eigen::VectorXd &x)
{
    for (uint32_t i = 0; i < s->x.v.rows; ++i) s->x.v.data[i] = x[i];
}

inline Eigen::MatrixXd dense(const Plx_SquMatrix &m)
{
    Eigen::MatrixXd e(m.size, m.size);
    for (uint32_t i = 0; i < m.size; ++i)
        for (uint32_t j = 0; j < m.size; ++j) e(i, j) = plx_squmat_get(&m, i, j);
    return e;
}

// ---- observation functions ----

// h(x) = x: a direct measurement of one state.
inline Plx_Bool h_identity(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *,
                           Plx_Vector *h, Plx_Matrix **J)
{
    const uint32_t n = s[0]->x.v.rows;
    for (uint32_t i = 0; i < n; ++i) h->data[i] = s[0]->x.v.data[i];
    if (J != nullptr && J[0] != nullptr) {
        plx_mat_fill_zero(J[0]);
        for (uint32_t i = 0; i < n; ++i) J[0]->data[i * n + i] = 1.0;
    }
    return PLX_TRUE;
}

// h(a, b) = b - a for two states of the same dimension.
inline Plx_Bool h_difference(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *,
                             Plx_Vector *h, Plx_Matrix **J)
{
    const uint32_t n = s[0]->x.v.rows;
    for (uint32_t i = 0; i < n; ++i) h->data[i] = s[1]->x.v.data[i] - s[0]->x.v.data[i];
    if (J != nullptr)
        for (int k = 0; k < 2; ++k)
            if (J[k] != nullptr) {
                plx_mat_fill_zero(J[k]);
                for (uint32_t i = 0; i < n; ++i) J[k]->data[i * n + i] = k == 0 ? -1.0 : 1.0;
            }
    return PLX_TRUE;
}

// A smooth nonlinear coupling of two 2-vectors: h(a, b) = (b0 - a0 a1, b1 - a0 + 0.1 a1^2).
inline Plx_Bool h_coupling(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *, Plx_Vector *h,
                           Plx_Matrix **J)
{
    const double *a = s[0]->x.v.data, *b = s[1]->x.v.data;
    h->data[0] = b[0] - a[0] * a[1];
    h->data[1] = b[1] - a[0] + 0.1 * a[1] * a[1];
    if (J != nullptr) {
        if (J[0] != nullptr) {
            const double v[4] = {-a[1], -a[0], -1.0, 0.2 * a[1]};
            plx_mat_fill(J[0], v);
        }
        if (J[1] != nullptr) {
            const double v[4] = {1.0, 0.0, 0.0, 1.0};
            plx_mat_fill(J[1], v);
        }
    }
    return PLX_TRUE;
}

// ---- dense reference ----

// Gauss-Newton normal equations of the active observations (all states initialised) over the
// active states, each weighted by its N as stored, laid out by state index; the prior A, b
// and M of the states are added.
struct DenseSystem {
    Eigen::MatrixXd H;
    Eigen::VectorXd g;
    std::map<const SumoStateVector *, int> offset;
};

inline void collect(SumoBranch *b, std::vector<SumoStateVector *> &out)
{
    if (b == nullptr) return;
    collect(b->sub, out);
    for (SumoStateVector *s = b->first; s != nullptr; s = s->next) {
        collect(s->sub_branch, out);
        if (s->status == SUMO_STATE_ACTIVE) out.push_back(s);
    }
}

inline DenseSystem dense_system(Sumo *sumo)
{
    DenseSystem d;
    std::vector<SumoStateVector *> states;
    collect(sumo->root, states);
    int total = 0;
    for (SumoStateVector *s : states) {
        d.offset[s] = total;
        total += int(s->x.v.rows);
    }
    d.H = Eigen::MatrixXd::Zero(total, total);
    d.g = Eigen::VectorXd::Zero(total);
    for (SumoStateVector *s : states) {
        const int o = d.offset[s], n = int(s->x.v.rows);
        d.H.block(o, o, n, n) += dense(s->A);
        for (int i = 0; i < n; ++i) d.g[o + i] += s->b.data[i];
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            const int oc = d.offset[k->col];
            Eigen::MatrixXd M(k->M.rows, k->M.cols);
            for (uint32_t i = 0; i < k->M.rows; ++i)
                for (uint32_t j = 0; j < k->M.cols; ++j) M(i, j) = k->M.data[i * k->M.cols + j];
            d.H.block(o, oc, M.rows(), M.cols()) += M;
            d.H.block(oc, o, M.cols(), M.rows()) += M.transpose();
        }
    }
    for (SumoObs *ob = sumo->obs_active; ob != nullptr; ob = ob->next) {
        bool init = true;
        for (uint32_t i = 0; i < ob->n_states; ++i) init = init && ob->states[i]->status == SUMO_STATE_ACTIVE;
        if (!init) continue;
        const uint32_t m = ob->z.v.rows;
        std::vector<Plx_Matrix> J(ob->n_states);
        std::vector<Plx_Matrix *> Jp(ob->n_states);
        for (uint32_t i = 0; i < ob->n_states; ++i) {
            plx_mat_form(&J[i], m, ob->states[i]->x.v.rows);
            Jp[i] = &J[i];
        }
        Plx_Vector h;
        plx_vec_form(&h, m);
        EXPECT_TRUE(ob->func.h(sumo, nullptr, ob->states, ob->n_states, &ob->z, &h, Jp.data()));
        Eigen::VectorXd r(m);
        for (uint32_t i = 0; i < m; ++i) r[i] = ob->z.v.data[i] - h.data[i];
        const Eigen::MatrixXd N = dense(ob->N) * ob->weight;
        for (uint32_t i = 0; i < ob->n_states; ++i) {
            Eigen::MatrixXd Ji(m, J[i].cols);
            for (uint32_t a = 0; a < m; ++a)
                for (uint32_t c = 0; c < J[i].cols; ++c) Ji(a, c) = J[i].data[a * J[i].cols + c];
            const int oi = d.offset[ob->states[i]];
            d.g.segment(oi, Ji.cols()) += Ji.transpose() * N * r;
            for (uint32_t j = 0; j < ob->n_states; ++j) {
                Eigen::MatrixXd Jj(m, J[j].cols);
                for (uint32_t a = 0; a < m; ++a)
                    for (uint32_t c = 0; c < J[j].cols; ++c) Jj(a, c) = J[j].data[a * J[j].cols + c];
                d.H.block(oi, d.offset[ob->states[j]], Ji.cols(), Jj.cols()) += Ji.transpose() * N * Jj;
            }
        }
        for (auto &j : J) plx_mat_free(&j);
        plx_vec_free(&h);
    }
    return d;
}

}  // namespace sumo_test

#endif
