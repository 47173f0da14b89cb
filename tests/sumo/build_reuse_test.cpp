// After a rejected step the optimiser reuses its previous build of the whole model instead of
// evaluating every observation again. Reuse must be invisible: every iteration gives the same
// bits as when each build is made afresh (forced here by marking the model modified, which
// only makes the optimiser recompute what it would reuse), and anything that changes the
// model between iterations is picked up.
#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <memory>
#include <vector>

#include "plano/sumo.h"

namespace {

// z_i = a exp(b t_i) + c at t_i = i / 4: nonlinear enough that steps from far away overshoot.
Plx_Bool h_exp(Sumo *, SumoWorkspace *, SumoStateVector **states, uint32_t, const SumoVector *z, Plx_Vector *h,
               Plx_Matrix **jacobians)
{
    const double *x = states[0]->x.v.data;
    for (uint32_t i = 0; i < z->v.rows; ++i) {
        const double t = 0.25 * i, e = std::exp(x[1] * t);
        if (h != nullptr) h->data[i] = x[0] * e + x[2];
        if (jacobians != nullptr && jacobians[0] != nullptr) {
            double *J = jacobians[0]->data + 3 * i;
            J[0] = e, J[1] = x[0] * t * e, J[2] = 1.0;
        }
    }
    return PLX_TRUE;
}

// z = x for a second state tied to the first by a difference observation.
Plx_Bool h_diff(Sumo *, SumoWorkspace *, SumoStateVector **states, uint32_t, const SumoVector *, Plx_Vector *h,
                Plx_Matrix **jacobians)
{
    const double *a = states[0]->x.v.data, *b = states[1]->x.v.data;
    for (uint32_t i = 0; i < 3; ++i) {
        if (h != nullptr) h->data[i] = a[i] - b[i];
        if (jacobians == nullptr) continue;
        for (uint32_t k = 0; k < 3; ++k) {
            if (jacobians[0] != nullptr) jacobians[0]->data[3 * i + k] = i == k ? 1.0 : 0.0;
            if (jacobians[1] != nullptr) jacobians[1]->data[3 * i + k] = i == k ? -1.0 : 0.0;
        }
    }
    return PLX_TRUE;
}

struct Model {
    Sumo *sumo = pSumoForm(nullptr, nullptr);
    SumoStateVector *curve = nullptr, *tied = nullptr;
    std::vector<double> zs;

    Model()
    {
        curve = state({0.2, -1.0, 3.0});
        tied = state({1.0, 1.0, 1.0});
        for (int i = 0; i < 24; ++i) zs.push_back(2.0 * std::exp(0.7 * 0.25 * i) + 0.5 + 0.01 * std::sin(3.0 * i));
        add_curve_obs(zs);
        const double zero[3] = {0, 0, 0};
        add_obs(zero, 3, 4.0, h_diff, {curve, tied});
    }
    ~Model() { vSumoFree(sumo, nullptr); }
    SumoStateVector *state(std::vector<double> x)
    {
        SumoStateVector *s = pSumoStateVectorNew(sumo, sumo->root, uint32_t(x.size()), nullptr, nullptr);
        Plx_Vector v;
        plx_vec_form_data(&v, uint32_t(x.size()), x.data());
        EXPECT_TRUE(bSumoStateVectorInit(sumo, s, &v));
        return s;
    }
    void add_obs(const double *z, uint32_t m, double info, SumoHFunction h, std::vector<SumoStateVector *> st)
    {
        Plx_Vector zv;
        plx_vec_form_data(&zv, m, const_cast<double *>(z));
        Plx_SquMatrix N;
        plx_squmat_form_data(&N, PLX_SQUMAT_SCALED_IDENTITY, m, &info);
        ASSERT_NE(pSumoObsH(sumo, &zv, &N, h, nullptr, st.data(), uint32_t(st.size())), nullptr);
    }
    void add_curve_obs(const std::vector<double> &z) { add_obs(z.data(), uint32_t(z.size()), 100.0, h_exp, {curve}); }
};

struct Step {
    uint32_t accepted;
    double reduction, residual;
    std::vector<double> x;
    bool operator==(const Step &o) const
    {
        return accepted == o.accepted && std::memcmp(&reduction, &o.reduction, sizeof reduction) == 0 &&
               std::memcmp(&residual, &o.residual, sizeof residual) == 0 && x == o.x;
    }
};

// The tracker's loop: lambda down after an accepted step, up after a rejected one. With
// `fresh`, every build is made anew.
std::vector<Step> run(bool fresh)
{
    Model m;
    uint32_t first = 0, last = 0;
    EXPECT_TRUE(bSumoCreateOffdiagBlocksBranch(m.sumo, m.sumo->root, &first, &last));
    std::vector<Step> steps;
    double lambda = 1e-6;
    for (int it = 0; it < 30; ++it) {
        if (fresh) m.sumo->modified = 1;
        Step s{};
        EXPECT_TRUE(bSumoLevMarqIterationBranchGen(m.sumo, m.sumo->root, nullptr, 1, lambda, SUMO_DAMP_ADDITIVE, first,
                                                   last, &s.accepted, &s.reduction, nullptr));
        s.residual = m.sumo->residual;
        for (SumoStateVector *st : {m.curve, m.tied}) s.x.insert(s.x.end(), st->x.v.data, st->x.v.data + 3);
        steps.push_back(s);
        lambda = s.accepted ? lambda * 0.1 : lambda * 10.0;
    }
    return steps;
}

int rejections(const std::vector<Step> &steps)
{
    int n = 0;
    for (const Step &s : steps) n += s.accepted ? 0 : 1;
    return n;
}

TEST(SumoBuildReuse, RejectedStepsGiveTheSameBitsAsFreshBuilds)
{
    // Accepted steps move the parameters, so reuse after them would show here too.
    const std::vector<Step> reused = run(false), fresh = run(true);
    ASSERT_GE(rejections(reused), 3);  // the case exercises reuse
    ASSERT_EQ(reused.size(), fresh.size());
    for (std::size_t i = 0; i < reused.size(); ++i) EXPECT_TRUE(reused[i] == fresh[i]) << "iteration " << i;
}

std::vector<double> params(const Model &m)
{
    std::vector<double> x;
    for (SumoStateVector *s = m.sumo->root->first; s != nullptr; s = s->next)
        x.insert(x.end(), s->x.v.data, s->x.v.data + s->x.v.rows);
    return x;
}

void set_params(Model &m, const std::vector<double> &x)
{
    std::size_t at = 0;
    for (SumoStateVector *s = m.sumo->root->first; s != nullptr; s = s->next)
        for (uint32_t k = 0; k < s->x.v.rows; ++k) s->x.v.data[k] = x[at++];
}

Step iterate(Model &m, double lambda)
{
    uint32_t first = 0, last = 0;
    EXPECT_TRUE(bSumoCreateOffdiagBlocksBranch(m.sumo, m.sumo->root, &first, &last));
    Step s{};
    EXPECT_TRUE(bSumoLevMarqIterationBranchGen(m.sumo, m.sumo->root, nullptr, 1, lambda, SUMO_DAMP_ADDITIVE, first,
                                               last, &s.accepted, &s.reduction, nullptr));
    s.residual = m.sumo->residual;
    s.x = params(m);
    return s;
}

TEST(SumoBuildReuse, ChangesAfterARejectionArePickedUp)
{
    // Iterate until a step is rejected, change the model, iterate once more: the step must
    // be the one a new model with the change, at the same parameters, takes first.
    using Change = void (*)(Model &);
    const Change changes[] = {
        // A new observation.
        [](Model &m) { m.add_curve_obs(std::vector<double>(m.zs.rbegin(), m.zs.rend())); },
        // A new state with an observation tying it in.
        [](Model &m) {
            SumoStateVector *s = m.state({0.5, 0.5, 0.5});
            const double zero[3] = {0, 0, 0};
            m.add_obs(zero, 3, 1.0, h_diff, {m.tied, s});
        },
    };
    for (const Change change : changes) {
        Model m;
        double lambda = 1e-6;
        Step s = iterate(m, lambda);
        for (int it = 0; it < 30 && s.accepted; ++it) {
            lambda = lambda * 0.1;
            s = iterate(m, lambda);
        }
        ASSERT_FALSE(s.accepted);
        lambda *= 10.0;
        change(m);
        const std::vector<double> x = params(m);
        const Step after = iterate(m, lambda);
        Model fresh;
        change(fresh);
        set_params(fresh, x);
        EXPECT_TRUE(after == iterate(fresh, lambda));
    }
}

}  // namespace
