// Eliminating and restoring observations and states, checked on linear problems where
// marginalisation is exact, against dense solves of the whole system.
#include <random>

#include "sumo_test_util.hpp"

using namespace sumo_test;

namespace {

constexpr uint32_t kAll = 0xFFFFFFFFu;

// A linear network: a chain e0 - e1 - a0 - a1 - a2 with a prior on e0 and a loop a0 - a2,
// plus e0 - a0 so that eliminating e0 and e1 couples their neighbours.
struct Network {
    SumoPtr sumo{pSumoForm(nullptr, nullptr)};
    WorkspacePtr ws{pSumoWorkspaceForm(nullptr)};
    std::vector<SumoStateVector *> s;

    explicit Network(uint32_t seed = 1)
    {
        std::mt19937 rng(seed);
        std::uniform_real_distribution<double> u(-1.0, 1.0);
        for (int i = 0; i < 5; ++i) {
            SumoStateVector *st = pSumoStateVectorNew(sumo.get(), sumo->root, 2, nullptr, nullptr);
            Vec x0{u(rng), u(rng)};
            EXPECT_TRUE(bSumoStateVectorInit(sumo.get(), st, &x0.v));
            s.push_back(st);
        }
        auto obs = [&](SumoHFunction f, std::vector<SumoStateVector *> st, double w) {
            Vec z{u(rng), u(rng)};
            Eigen::MatrixXd N(2, 2);
            N << w, 0.3, 0.3, 1.0 + w;
            Squ Ni(N);
            EXPECT_NE(pSumoObsH(sumo.get(), &z.v, &Ni.m, f, nullptr, st.data(), uint32_t(st.size())), nullptr);
        };
        obs(h_identity, {s[0]}, 2.0);
        obs(h_identity, {s[3]}, 0.5);
        for (int i = 0; i < 4; ++i) obs(h_difference, {s[i], s[i + 1]}, 1.0 + i);
        obs(h_difference, {s[2], s[4]}, 3.0);
        obs(h_difference, {s[0], s[2]}, 1.5);
    }
    Eigen::VectorXd x(const std::vector<SumoStateVector *> &v) const
    {
        Eigen::VectorXd r(2 * v.size());
        for (size_t i = 0; i < v.size(); ++i) r.segment(2 * i, 2) = params(v[i]);
        return r;
    }
};

// The optimum of the whole linear problem, state by state.
std::vector<Eigen::VectorXd> optimum(Network &n)
{
    EXPECT_TRUE(bSumoSetStateIndices(n.sumo.get()));
    const DenseSystem d = dense_system(n.sumo.get());
    const Eigen::VectorXd delta = d.H.ldlt().solve(d.g);
    std::vector<Eigen::VectorXd> r;
    for (SumoStateVector *st : n.s) r.push_back(params(st) + delta.segment(d.offset.at(st), 2));
    return r;
}

TEST(SumoMarginalise, ObservationEliminationKeepsTheSystem)
{
    Network n;
    ASSERT_TRUE(bSumoSetStateIndices(n.sumo.get()));
    const DenseSystem before = dense_system(n.sumo.get());
    SumoObs *loop = n.sumo->obs_active->next;  // the a0 - a2 difference
    ASSERT_EQ(loop->states[0], n.s[2]);
    loop->store_states = 1;
    ASSERT_TRUE(bSumoObsEliminate(n.sumo.get(), n.ws.get(), loop, nullptr));
    EXPECT_EQ(loop->eliminated, 1u);
    EXPECT_EQ(n.sumo->obs_eliminated, loop);
    EXPECT_EQ(n.s[2]->obs_eliminated, loop);
    ASSERT_NE(loop->stored_states, nullptr);
    EXPECT_EQ(loop->stored_states[1].data[0], n.s[4]->x.v.data[0]);
    // The information moved to the fixed prior: the same dense system.
    const DenseSystem mid = dense_system(n.sumo.get());
    EXPECT_LT((mid.H - before.H).norm(), 1e-12);
    EXPECT_LT((mid.g - before.g).norm(), 1e-12);
    EXPECT_FALSE(bSumoObsEliminate(n.sumo.get(), n.ws.get(), loop, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    // Costs count eliminated observations only when asked.
    const double active = dSumoComputeResidual(n.sumo.get(), 0, nullptr);
    const double all = dSumoComputeResidual(n.sumo.get(), 1, nullptr);
    EXPECT_NEAR(all - active, dSumoObsComputeResidual(n.sumo.get(), n.ws.get(), loop), 1e-12);
    // Restoring takes it back out: the prior is zero again.
    ASSERT_TRUE(bSumoObsRestore(n.sumo.get(), n.ws.get(), loop, nullptr));
    EXPECT_EQ(n.sumo->obs_eliminated, nullptr);
    EXPECT_LT(dense(n.s[2]->A).norm(), 1e-12);
    EXPECT_LT(dense(n.s[4]->A).norm(), 1e-12);
    // Deleting an eliminated observation also takes its information out.
    ASSERT_TRUE(bSumoObsEliminate(n.sumo.get(), n.ws.get(), loop, nullptr));
    ASSERT_TRUE(bSumoObsDelete(n.sumo.get(), n.ws.get(), loop, nullptr));
    EXPECT_LT(dense(n.s[4]->A).norm(), 1e-12);
    EXPECT_LT(Eigen::Map<Eigen::Vector2d>(n.s[4]->b.data).norm(), 1e-12);
    // Selection by predicate.
    auto on_s0 = [](const SumoObs *o, void *ctx) -> uint32_t { return o->states[0] == ctx ? 1u : 0u; };
    ASSERT_TRUE(bSumoObsEliminateSelected(n.sumo.get(), n.ws.get(), on_s0, n.s[0], nullptr));
    EXPECT_EQ(n.s[0]->obs_active, nullptr);
    EXPECT_EQ(uiSumoStateVectorObsListSize(n.s[1]), 1u);
}

TEST(SumoMarginalise, EliminatedStatesLeaveTheExactMarginal)
{
    // With fill-in, marginalisation of a linear problem loses nothing; without it the coupling
    // e0 left between e1 and a0 (no block yet) is dropped and the answer moves.
    for (uint32_t adjust : {SUMO_ADJUST_FULL, SUMO_ADJUST_NO_FILL_IN}) {
        Network n;
        const std::vector<Eigen::VectorXd> best = optimum(n);
        ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[0], adjust, nullptr));
        ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[1], adjust, nullptr));
        EXPECT_EQ(n.s[0]->status, SUMO_STATE_ELIMINATED);
        EXPECT_EQ(n.s[0]->index, 0u);
        EXPECT_EQ(n.s[1]->index, 1u);
        EXPECT_EQ(n.sumo->elim_last, n.s[1]);
        EXPECT_EQ(n.sumo->root->first, n.s[2]);
        for (int it = 0; it < 2; ++it)
            ASSERT_TRUE(bSumoLevMarqIterationBranchGen(n.sumo.get(), n.sumo->root, nullptr, 1, 0.0, 0, kAll, kAll,
                                                       nullptr, nullptr, nullptr));
        double worst = 0.0;
        for (int i = 0; i < 5; ++i) worst = std::max(worst, (params(n.s[i]) - best[i]).norm());
        if (adjust == SUMO_ADJUST_FULL)
            EXPECT_LT(worst, 1e-9);
        else
            EXPECT_GT(worst, 1e-6);
    }
}

TEST(SumoMarginalise, PriorFollowsAcceptedSteps)
{
    // Eliminate far from the optimum, then let LM move the active states in several steps:
    // the eliminated states and the prior must track them.
    Network n(4);
    const std::vector<Eigen::VectorXd> best = optimum(n);
    ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[4], SUMO_ADJUST_FULL, nullptr));
    double lambda = 10.0;
    for (int it = 0; it < 60; ++it) {
        uint32_t accepted;
        ASSERT_TRUE(bSumoLevMarqIterationBranchGen(n.sumo.get(), n.sumo->root, nullptr, 1, lambda, 0, kAll, kAll,
                                                   &accepted, nullptr, nullptr));
        // The cost no longer sees the eliminated observations, so only damping limits steps.
        lambda *= 0.5;
    }
    for (int i = 0; i < 5; ++i) EXPECT_LT((params(n.s[i]) - best[i]).norm(), 1e-8) << "state " << i;
}

TEST(SumoMarginalise, CovariancesOfActiveAndEliminatedStates)
{
    Network n;
    ASSERT_TRUE(bSumoSetStateIndices(n.sumo.get()));
    const DenseSystem d = dense_system(n.sumo.get());
    const Eigen::MatrixXd inv = d.H.inverse();
    ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[1], SUMO_ADJUST_FULL, nullptr));
    ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[0], SUMO_ADJUST_FULL, nullptr));
    ASSERT_TRUE(bSumoLevMarqIterationBranchGen(n.sumo.get(), n.sumo->root, n.s[1], 0, 0.0, 0, kAll, kAll, nullptr,
                                               nullptr, nullptr));
    EXPECT_EQ(n.sumo->covariance_done, 1u);
    for (int i = 0; i < 5; ++i) {
        const int o = d.offset.at(n.s[i]);
        EXPECT_EQ(n.s[i]->covariance_valid, 1u);
        EXPECT_LT((dense(n.s[i]->covariance) - inv.block(o, o, 2, 2)).norm(), 1e-9) << "state " << i;
    }
}

TEST(SumoMarginalise, EliminateThenRestoreGivesBackTheInformation)
{
    Network n;
    // s4 touches s2 and s3 only, s0 touches s1 and s2: s4 can come back while s0 stays out.
    ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[4], SUMO_ADJUST_FULL, nullptr));
    ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[0], SUMO_ADJUST_FULL, nullptr));
    EXPECT_EQ(n.s[0]->index, 1u);
    ASSERT_TRUE(bSumoStateRestore(n.sumo.get(), n.ws.get(), n.s[4], n.sumo->root, SUMO_ADJUST_FULL, nullptr));
    EXPECT_EQ(n.s[0]->index, 0u);
    EXPECT_EQ(n.s[4]->status, SUMO_STATE_ACTIVE);
    EXPECT_EQ(n.sumo->elim_last, n.s[0]);
    EXPECT_EQ(n.sumo->elim_first, n.s[0]);
    ASSERT_TRUE(bSumoStateRestore(n.sumo.get(), n.ws.get(), n.s[0], n.sumo->root, SUMO_ADJUST_FULL, nullptr));
    EXPECT_EQ(n.sumo->elim_last, nullptr);
    EXPECT_EQ(n.sumo->root->last, n.s[0]);
    // The whole system (now held as prior) equals the original one at the same parameters.
    Network fresh;
    for (int i = 0; i < 5; ++i) set_params(fresh.s[i], params(n.s[i]));
    ASSERT_TRUE(bSumoSetStateIndices(n.sumo.get()));
    ASSERT_TRUE(bSumoSetStateIndices(fresh.sumo.get()));
    const DenseSystem a = dense_system(n.sumo.get()), b = dense_system(fresh.sumo.get());
    for (int i = 0; i < 5; ++i) {
        const int oa = a.offset.at(n.s[i]), ob = b.offset.at(fresh.s[i]);
        EXPECT_LT((a.g.segment(oa, 2) - b.g.segment(ob, 2)).norm(), 1e-9) << "state " << i;
        for (int j = 0; j < 5; ++j)
            EXPECT_LT((a.H.block(oa, a.offset.at(n.s[j]), 2, 2) - b.H.block(ob, b.offset.at(fresh.s[j]), 2, 2)).norm(),
                      1e-9);
    }
    // Blocks are oriented by the new order.
    for (SumoStateVector *st : n.s)
        for (SumoOffdiag *k = st->row_blocks; k != nullptr; k = k->row_next) EXPECT_LT(k->row->index, k->col->index);
}

TEST(SumoMarginalise, RefusedEliminationsAndRestores)
{
    Network n;
    EXPECT_FALSE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[0], 3, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_ILLEGAL_TYPE);
    // A restore of an active state does nothing.
    EXPECT_TRUE(bSumoStateRestore(n.sumo.get(), n.ws.get(), n.s[0], n.sumo->root, SUMO_ADJUST_FULL, nullptr));
    ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[0], SUMO_ADJUST_FULL, nullptr));
    EXPECT_FALSE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[0], SUMO_ADJUST_FULL, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    // Its neighbour s1 eliminated after it: s0 must wait for s1.
    ASSERT_TRUE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), n.s[1], SUMO_ADJUST_FULL, nullptr));
    EXPECT_FALSE(bSumoStateRestore(n.sumo.get(), n.ws.get(), n.s[0], n.sumo->root, SUMO_ADJUST_FULL, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_EQ(n.s[0]->status, SUMO_STATE_ELIMINATED);
    // An observation whose state went cannot be restored or deleted.
    SumoObs *prior = n.s[0]->obs_eliminated;
    ASSERT_NE(prior, nullptr);
    EXPECT_FALSE(bSumoObsRestore(n.sumo.get(), n.ws.get(), prior, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_FALSE(bSumoObsDelete(n.sumo.get(), n.ws.get(), prior, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    // New observations cannot name an eliminated state.
    Vec z{0.0, 0.0};
    Squ N(2, 1.0);
    EXPECT_EQ(pSumoObsH_va(n.sumo.get(), &z.v, &N.m, h_identity, nullptr, n.s[0], nullptr), nullptr);
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    // An uninitialised state cannot be eliminated.
    SumoStateVector *u = pSumoStateVectorNew(n.sumo.get(), n.sumo->root, 2, nullptr, nullptr);
    EXPECT_FALSE(bSumoStateEliminate(n.sumo.get(), n.ws.get(), u, SUMO_ADJUST_FULL, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_NOT_INITIALISED);
    // Restoring in reverse order works.
    ASSERT_TRUE(bSumoStateRestore(n.sumo.get(), n.ws.get(), n.s[1], n.sumo->root, SUMO_ADJUST_FULL, nullptr));
    ASSERT_TRUE(bSumoStateRestore(n.sumo.get(), n.ws.get(), n.s[0], n.sumo->root, SUMO_ADJUST_FULL, nullptr));
}

TEST(SumoMarginalise, BranchEliminationMarginalisesItsStates)
{
    Network n;
    // Hang a two-state branch from s3, linked to s3 and s1.
    SumoBranch *hang = pSumoBranchNewFromState(n.sumo.get(), n.s[3]);
    std::vector<SumoStateVector *> h;
    for (int i = 0; i < 2; ++i) {
        SumoStateVector *st = pSumoStateVectorNew(n.sumo.get(), hang, 2, nullptr, nullptr);
        Vec x0{0.1 * i, -0.2};
        ASSERT_TRUE(bSumoStateVectorInit(n.sumo.get(), st, &x0.v));
        h.push_back(st);
    }
    Vec z{0.3, 0.1};
    Squ N(2, 2.0);
    ASSERT_NE(pSumoObsH_va(n.sumo.get(), &z.v, &N.m, h_difference, nullptr, h[0], h[1], nullptr), nullptr);
    ASSERT_NE(pSumoObsH_va(n.sumo.get(), &z.v, &N.m, h_difference, nullptr, h[1], n.s[3], nullptr), nullptr);
    ASSERT_NE(pSumoObsH_va(n.sumo.get(), &z.v, &N.m, h_difference, nullptr, h[0], n.s[1], nullptr), nullptr);
    const std::vector<Eigen::VectorXd> best = optimum(n);
    ASSERT_TRUE(bSumoSetStateIndices(n.sumo.get()));
    const DenseSystem d = dense_system(n.sumo.get());
    const Eigen::VectorXd delta = d.H.ldlt().solve(d.g);
    const Eigen::VectorXd h1_best = params(h[1]) + delta.segment(d.offset.at(h[1]), 2);
    ASSERT_TRUE(bSumoBranchEliminate(n.sumo.get(), n.ws.get(), hang, SUMO_ADJUST_FULL, nullptr));
    EXPECT_EQ(n.s[3]->sub_branch, nullptr);
    EXPECT_EQ(h[1]->status, SUMO_STATE_ELIMINATED);
    ASSERT_TRUE(bSumoLevMarqIterationBranchGen(n.sumo.get(), n.sumo->root, nullptr, 1, 0.0, 0, kAll, kAll, nullptr,
                                               nullptr, nullptr));
    for (int i = 0; i < 5; ++i) EXPECT_LT((params(n.s[i]) - best[i]).norm(), 1e-9) << "state " << i;
    EXPECT_LT((params(h[1]) - h1_best).norm(), 1e-9);
}

}  // namespace
