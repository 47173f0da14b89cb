// The solver against closed forms and against a dense Gauss-Newton reference.
#include <functional>
#include <random>
#include <tuple>

#include "sumo_test_util.hpp"

using namespace sumo_test;

namespace {

constexpr uint32_t kAll = 0xFFFFFFFFu;

// ---- a straight line y = a x + b, one observation per point, x in the observation's data ----

Plx_Bool h_line(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *z, Plx_Vector *h,
                Plx_Matrix **J)
{
    const double x = *static_cast<const double *>(z->user_data);
    h->data[0] = s[0]->x.v.data[0] * x + s[0]->x.v.data[1];
    if (J != nullptr && J[0] != nullptr) {
        J[0]->data[0] = x;
        J[0]->data[1] = 1.0;
    }
    return PLX_TRUE;
}

struct LineFit {
    SumoPtr sumo;
    SumoStateVector *line;
    std::vector<double> xs, ys;
    double sigma = 0.5;

    // `points` observations (enough for real worker threads to take part when many).
    explicit LineFit(bool numeric, const ThreadHostInterface *host = nullptr, int points = 12)
        : sumo(pSumoForm(nullptr, host))
    {
        line = pSumoStateVectorNew(sumo.get(), sumo->root, 2, nullptr, nullptr);
        Vec x0{0.3, -1.0};
        EXPECT_TRUE(bSumoStateVectorInit(sumo.get(), line, &x0.v));
        std::mt19937 rng(7);
        std::normal_distribution<double> noise(0.0, sigma);
        for (int i = 0; i < points; ++i) {
            xs.push_back(i * 8.4 / points - 3.0);
            ys.push_back(1.7 * xs.back() + 0.4 + noise(rng));
        }
        add(0, points, numeric);
    }
    void add(int from, int to, bool numeric)
    {
        for (int i = from; i < to; ++i) {
            Vec z{ys[i]};
            Squ Ni(1, 1.0 / (sigma * sigma));
            SumoObs *o = pSumoObsH_va(sumo.get(), &z.v, &Ni.m, h_line, nullptr, line, nullptr);
            EXPECT_NE(o, nullptr);
            o->z.user_data = &xs[i];
            o->numeric_jacobians = numeric ? 1u : 0u;
        }
    }
    // Ordinary least squares by the textbook formulas.
    void closed_form(double &a, double &b, Eigen::Matrix2d &cov) const
    {
        const double n = double(xs.size());
        double sx = 0, sy = 0, sxx = 0, sxy = 0;
        for (size_t i = 0; i < xs.size(); ++i) {
            sx += xs[i];
            sy += ys[i];
            sxx += xs[i] * xs[i];
            sxy += xs[i] * ys[i];
        }
        a = (n * sxy - sx * sy) / (n * sxx - sx * sx);
        b = (sy - a * sx) / n;
        const double det = n * sxx - sx * sx;
        cov << n / det, -sx / det, -sx / det, sxx / det;
        cov *= sigma * sigma;
    }
};

TEST(SumoSolver, StraightLineMatchesClosedForm)
{
    double a, b;
    Eigen::Matrix2d cov;
    LineFit(false).closed_form(a, b, cov);
    // One Gauss-Newton step solves a linear problem: analytically, with more jobs than
    // observations (the empty chunks complete at once), and by central differences.
    for (const auto &[numeric, jobs, tol] :
         std::vector<std::tuple<bool, uint32_t, double>>{{false, 0, 1e-12}, {false, 16, 1e-12}, {true, 0, 1e-7}}) {
        HostPtr host(jobs ? plano_host_new(jobs) : nullptr);
        const ThreadHostInterface *iface = jobs ? plano_host_interface(host.get()) : nullptr;
        LineFit fit(numeric, iface);
        ASSERT_TRUE(iterate(fit.sumo.get(), 0.0, nullptr, nullptr, iface));
        EXPECT_NEAR(fit.line->x.v.data[0], a, tol);
        EXPECT_NEAR(fit.line->x.v.data[1], b, tol);
        if (jobs) {
            EXPECT_EQ(fit.sumo->n_threads, jobs);
            vThreadedWorkerPoolFree();
            continue;
        }
        // Covariance mode leaves the parameters and gives the inverse information.
        ASSERT_TRUE(iterate(fit.sumo.get(), 0.0, nullptr, nullptr, nullptr, 0, 0));
        EXPECT_EQ(fit.sumo->covariance_done, 1u);
        EXPECT_EQ(fit.line->covariance_valid, 1u);
        EXPECT_NEAR(fit.line->x.v.data[0], a, tol);
        EXPECT_TRUE(dense(*pgsmSumoGetCovmatDiag(fit.line)).isApprox(cov, numeric ? 1e-6 : 1e-12));
    }
    // Levenberg-Marquardt with damping converges to the same line and reports its gains.
    LineFit fit(false);
    const double c0 = dSumoComputeResidual(fit.sumo.get(), 0, nullptr);
    double lambda = 1.0, total = 0.0;
    for (int it = 0; it < 40; ++it) {
        uint32_t accepted = 7;
        double reduction = -1.0;
        ASSERT_TRUE(iterate(fit.sumo.get(), lambda, &accepted, &reduction));
        EXPECT_EQ(reduction > 0.0, accepted == 1u);
        EXPECT_GE(reduction, 0.0);
        total += reduction;
        lambda *= accepted ? 0.1 : 10.0;
    }
    EXPECT_NEAR(fit.line->x.v.data[0], a, 1e-9);
    EXPECT_NEAR(fit.line->x.v.data[1], b, 1e-9);
    EXPECT_NEAR(c0 - total, dSumoComputeResidual(fit.sumo.get(), 0, nullptr), 1e-9);
    EXPECT_NEAR(fit.sumo->residual, c0 - total, 1e-9);
}

// The same line as an F-type: z = (x, y) with covariance diag(0, sigma^2) and
// F = y - a x - b, a single equation (F is resized to 1).
Plx_Bool f_line(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *z, Plx_Vector *F,
                Plx_Matrix **J, Plx_Matrix *Fz)
{
    const double a = s[0]->x.v.data[0], b = s[0]->x.v.data[1];
    if (!plx_vec_resize(F, 1)) return PLX_FALSE;
    F->data[0] = z->v.data[1] - a * z->v.data[0] - b;
    if (J != nullptr && J[0] != nullptr) {
        if (!plx_mat_resize(J[0], 1, 2)) return PLX_FALSE;
        J[0]->data[0] = -z->v.data[0];
        J[0]->data[1] = -1.0;
    }
    if (Fz != nullptr) {
        if (!plx_mat_resize(Fz, 1, 2)) return PLX_FALSE;
        Fz->data[0] = -a;
        Fz->data[1] = 1.0;
    }
    return PLX_TRUE;
}

TEST(SumoSolver, FTypeLineAndRobustOutlier)
{
    LineFit reference(false);
    double a, b;
    Eigen::Matrix2d cov;
    reference.closed_form(a, b, cov);
    for (bool numeric : {false, true}) {
        SumoPtr sumo(pSumoForm(nullptr, nullptr));
        SumoStateVector *line = pSumoStateVectorNew(sumo.get(), sumo->root, 2, nullptr, nullptr);
        Vec x0{0.3, -1.0};
        ASSERT_TRUE(bSumoStateVectorInit(sumo.get(), line, &x0.v));
        Eigen::Matrix2d N = Eigen::Vector2d(0.0, reference.sigma * reference.sigma).asDiagonal();
        Squ Nm(N);
        for (size_t i = 0; i < reference.xs.size(); ++i) {
            Vec z{reference.xs[i], reference.ys[i]};
            SumoObs *o = pSumoObsF_va(sumo.get(), &z.v, &Nm.m, f_line, nullptr, line, nullptr);
            ASSERT_NE(o, nullptr);
            o->numeric_jacobians = numeric ? 1u : 0u;
        }
        // A gross outlier, robust: after the first decisions it counts for little.
        Vec zo{1.0, 40.0};
        ASSERT_NE(pSumoObsFRobust_va(sumo.get(), &zo.v, &Nm.m, f_line, 100.0, 9.0, nullptr, line, nullptr), nullptr);
        for (int it = 0; it < 4; ++it)
            ASSERT_TRUE(iterate(sumo.get()));
        EXPECT_EQ(sumo->obs_active->outlier, 1u);
        // With information divided by 100 the outlier still pulls a little; without it the
        // fit is the plain least-squares line.
        EXPECT_NEAR(line->x.v.data[0], a, 0.05);
        EXPECT_NEAR(line->x.v.data[1], b, 0.5);
        WorkspacePtr ws(pSumoWorkspaceForm(nullptr));
        ASSERT_TRUE(bSumoObsDelete(sumo.get(), ws.get(), sumo->obs_active, nullptr));
        ASSERT_TRUE(iterate(sumo.get()));
        EXPECT_NEAR(line->x.v.data[0], a, numeric ? 1e-7 : 1e-12);
        EXPECT_NEAR(line->x.v.data[1], b, numeric ? 1e-7 : 1e-12);
    }
}

Plx_Bool h_fails(Sumo *, SumoWorkspace *, SumoStateVector **, uint32_t, const SumoVector *, Plx_Vector *, Plx_Matrix **)
{
    PLX_ERR_START(PLX_ERROR_OUTSIDE_RANGE, "test failure", 0);
    return PLX_FALSE;
}

TEST(SumoSolver, FailingObservationFailsTheIterationOnAnyThread)
{
    for (uint32_t jobs : {0u, 3u}) {
        HostPtr host(jobs ? plano_host_new(jobs) : nullptr);
        const ThreadHostInterface *iface = jobs ? plano_host_interface(host.get()) : nullptr;
        // Enough observations for the jobs to run on workers, the failing one in the middle
        // chunk (not the caller's).
        LineFit fit(false, iface, 1000);
        Vec z{0.0};
        Squ Ni(1, 1.0);
        ASSERT_NE(pSumoObsH_va(fit.sumo.get(), &z.v, &Ni.m, h_fails, nullptr, fit.line, nullptr), nullptr);
        fit.add(0, 1000, false);
        EXPECT_EQ(dSumoComputeResidual(fit.sumo.get(), 0, iface), SUMO_FAILED_RESIDUAL);
        EXPECT_FALSE(iterate(fit.sumo.get(), 0.0, nullptr, nullptr, iface));
        Plx_ErrorRecord origin;
        ASSERT_TRUE(plx_err_get_error(0, &origin));
        EXPECT_EQ(origin.code, PLX_ERROR_OUTSIDE_RANGE);
        EXPECT_GT(plx_err_get_error_count(), 1u);
    }
    vThreadedWorkerPoolFree();
}

// ---- a chain of states with hanging and sub-branches, against a dense solve ----

struct Chain {
    SumoPtr sumo;
    WorkspacePtr ws{pSumoWorkspaceForm(nullptr)};
    std::vector<SumoStateVector *> root_states, hang_states;
    SumoStateVector *sub_state = nullptr;

    explicit Chain(const ThreadHostInterface *host = nullptr, bool nonlinear = true) : sumo(pSumoForm(nullptr, host))
    {
        std::mt19937 rng(11);
        std::uniform_real_distribution<double> u(-0.5, 0.5);
        auto make = [&](SumoBranch *b) {
            SumoStateVector *s = pSumoStateVectorNew(sumo.get(), b, 2, nullptr, nullptr);
            Vec x0{u(rng), u(rng)};
            EXPECT_TRUE(bSumoStateVectorInit(sumo.get(), s, &x0.v));
            return s;
        };
        for (int i = 0; i < 4; ++i) root_states.push_back(make(sumo->root));
        SumoBranch *hang = pSumoBranchNewFromState(sumo.get(), root_states[2]);
        hang_states = {make(hang), make(hang)};
        sub_state = make(pSumoBranchNewFromBranch(sumo.get(), sumo->root));
        auto N_of = [&](int kind) -> Eigen::MatrixXd {
            if (kind == 0) return Eigen::MatrixXd::Identity(2, 2) * 4.0;
            if (kind == 1) return Eigen::Vector2d(2.0, 0.5).asDiagonal();
            Eigen::MatrixXd m(2, 2);
            m << 3.0, 0.8, 0.8, 1.5;
            return m;
        };
        int kind = 0;
        auto obs = [&](SumoHFunction f, std::vector<SumoStateVector *> st) {
            Vec z{u(rng), u(rng)};
            Squ N(N_of(kind++ % 3));
            EXPECT_NE(pSumoObsH(sumo.get(), &z.v, &N.m, f, nullptr, st.data(), uint32_t(st.size())), nullptr);
        };
        SumoHFunction pair = nonlinear ? h_coupling : h_difference;
        obs(h_identity, {root_states[0]});
        obs(h_identity, {sub_state});
        for (int i = 0; i < 3; ++i) obs(pair, {root_states[i], root_states[i + 1]});
        obs(pair, {hang_states[0], hang_states[1]});
        obs(pair, {hang_states[1], root_states[2]});
        obs(pair, {hang_states[0], root_states[3]});  // fill-in across the hanging branch
        obs(pair, {sub_state, root_states[1]});
        obs(pair, {hang_states[0], sub_state});       // the sub-branch state is eliminated first
    }
    std::vector<SumoStateVector *> all() const
    {
        std::vector<SumoStateVector *> v = root_states;
        v.insert(v.end(), hang_states.begin(), hang_states.end());
        v.push_back(sub_state);
        return v;
    }
    // The dense Gauss-Newton step from the present parameters: where each state starts, and its step.
    using Step = std::map<SumoStateVector *, std::pair<Eigen::VectorXd, Eigen::VectorXd>>;
    Step dense_step() const
    {
        const DenseSystem d = dense_system(sumo.get());
        const Eigen::VectorXd delta = d.H.ldlt().solve(d.g);
        Step step;
        for (SumoStateVector *s : all()) step[s] = {params(s), delta.segment(d.offset.at(s), 2)};
        return step;
    }
    void expect_took(const Step &step) const
    {
        for (SumoStateVector *s : all())
            EXPECT_LT((params(s) - step.at(s).first - step.at(s).second).norm(), 1e-9) << "state " << s->index;
    }
};

TEST(SumoSolver, ChainWithBranchesMatchesDenseGaussNewton)
{
    Chain c;
    ASSERT_TRUE(bSumoSetStateIndices(c.sumo.get()));
    // Elimination order: sub-branch first, then the root with the hanging branch before r2.
    EXPECT_EQ(c.sub_state->index, 0u);
    EXPECT_EQ(c.root_states[0]->index, 1u);
    EXPECT_EQ(c.hang_states[0]->index, 3u);
    EXPECT_EQ(c.root_states[2]->index, 5u);
    const auto step = c.dense_step();
    ASSERT_TRUE(iterate(c.sumo.get()));
    c.expect_took(step);
    // Fill-in made the blocks the dense matrix needs: h0 (3) now meets r1 (2) through s0.
    SumoOffdiag *fill = nullptr;
    ASSERT_TRUE(bSumoOffdiagSearchGen(c.sumo.get(), c.root_states[1], c.hang_states[0], 0, nullptr, nullptr, &fill));
    EXPECT_NE(fill, nullptr);

    // Covariances at the new point: the blocks of the inverse dense information.
    const DenseSystem d2 = dense_system(c.sumo.get());
    const Eigen::MatrixXd inv = d2.H.inverse();
    ASSERT_TRUE(iterate(c.sumo.get(), 0.0, nullptr, nullptr, nullptr, 0, 0));
    for (SumoStateVector *s : c.all()) {
        const int o = d2.offset.at(s);
        EXPECT_LT((dense(s->covariance) - inv.block(o, o, 2, 2)).norm(), 1e-9) << "state " << s->index;
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            Eigen::MatrixXd P(2, 2);
            for (int i = 0; i < 4; ++i) P(i / 2, i % 2) = k->M_cov.data[i];
            EXPECT_LT((P - inv.block(o, d2.offset.at(k->col), 2, 2)).norm(), 1e-9);
        }
    }
}

TEST(SumoSolver, ReorderedStatesStillMatchTheDenseSolve)
{
    // Moving states changes the elimination order and flips blocks; after a solve has made
    // fill-in blocks, the next solve must still agree with the dense one.
    Chain c;
    ASSERT_TRUE(iterate(c.sumo.get(), 0.5));
    ASSERT_TRUE(bSumoStateVectorMoveBranch(c.sumo.get(), c.ws.get(), c.root_states[0], c.sumo->root));
    ASSERT_TRUE(bSumoStateVectorMoveBranch(c.sumo.get(), c.ws.get(), c.sub_state, c.root_states[2]->sub_branch));
    ASSERT_TRUE(bSumoSetStateIndices(c.sumo.get()));
    EXPECT_EQ(c.sumo->root->last, c.root_states[0]);
    const auto step = c.dense_step();
    ASSERT_TRUE(iterate(c.sumo.get()));
    c.expect_took(step);
}

TEST(SumoSolver, StateRangeSolvesItsRunWithTheRestHeld)
{
    Chain c;
    ASSERT_TRUE(bSumoSetStateIndices(c.sumo.get()));
    const DenseSystem d = dense_system(c.sumo.get());
    // r1..r3 with r2's hanging branch: indices 2..6; the others stay fixed.
    SumoStateVector *first = c.root_states[1], *last = c.root_states[3];
    uint32_t lo, hi;
    ASSERT_TRUE(bSumoGetIndexLimitsStateRange(first, last, &lo, &hi));
    EXPECT_EQ(lo, 2u);
    EXPECT_EQ(hi, 6u);
    std::vector<SumoStateVector *> run = {c.root_states[1], c.hang_states[0], c.hang_states[1], c.root_states[2],
                                          c.root_states[3]};
    Eigen::MatrixXd H(10, 10);
    Eigen::VectorXd g(10);
    for (int i = 0; i < 5; ++i) {
        g.segment(2 * i, 2) = d.g.segment(d.offset.at(run[i]), 2);
        for (int j = 0; j < 5; ++j) H.block(2 * i, 2 * j, 2, 2) = d.H.block(d.offset.at(run[i]), d.offset.at(run[j]), 2, 2);
    }
    const Eigen::VectorXd delta = H.ldlt().solve(g);
    std::map<SumoStateVector *, Eigen::VectorXd> before;
    for (SumoStateVector *s : c.all()) before[s] = params(s);
    ASSERT_TRUE(bSumoLevMarqIterationStateRange(c.sumo.get(), first, last, 0.0, 0, lo, hi, nullptr, nullptr, nullptr));
    for (int i = 0; i < 5; ++i) EXPECT_LT((params(run[i]) - before[run[i]] - delta.segment(2 * i, 2)).norm(), 1e-9);
    EXPECT_EQ(params(c.root_states[0]), before[c.root_states[0]]);
    EXPECT_EQ(params(c.sub_state), before[c.sub_state]);

    // An unset first index with a set last index is refused; both unset builds nothing.
    EXPECT_FALSE(bSumoBuildInformationBlocksStateRange(c.sumo.get(), first, last, kAll, 4, nullptr));
    EXPECT_EQ(error_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_TRUE(bSumoBuildInformationBlocksStateRange(c.sumo.get(), first, last, kAll, kAll, nullptr));
    EXPECT_EQ(first->A_work.data[0], first->A.data[0]);
}

// Everything a build leaves in the work copies, state by state in index order.
std::vector<double> work_copies(Sumo *sumo)
{
    std::vector<SumoStateVector *> states;
    collect(sumo->root, states);
    std::vector<double> v;
    for (SumoStateVector *s : states) {
        const uint32_t n = s->x.v.rows;
        v.insert(v.end(), s->A_work.data, s->A_work.data + n * n);
        v.insert(v.end(), s->b_work.data, s->b_work.data + n);
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next)
            v.insert(v.end(), k->M_work.data, k->M_work.data + k->M_work.rows * k->M_work.cols);
    }
    return v;
}

void expect_close(const std::vector<double> &x, const std::vector<double> &ref, double tol, const char *what)
{
    ASSERT_EQ(x.size(), ref.size()) << what;
    for (size_t i = 0; i < x.size(); ++i) EXPECT_NEAR(x[i], ref[i], tol * (1.0 + std::abs(ref[i]))) << what << " " << i;
}

TEST(SumoSolver, SameParametersForAnyNumberOfJobs)
{
    auto solve = [](const ThreadHostInterface *host, bool range) {
        Chain c(host);
        // Central differences on some observations: jobs sharing a state must not see each
        // other's steps.
        for (SumoObs *o = c.sumo->obs_active; o != nullptr; o = o->next->next) {
            o->numeric_jacobians = 1;
            if (o->next == nullptr) break;
        }
        double lambda = 1e-2;
        for (int it = 0; it < 6; ++it) {
            uint32_t accepted;
            if (range) {
                EXPECT_TRUE(bSumoSetStateIndices(c.sumo.get()));
                EXPECT_TRUE(bSumoLevMarqIterationStateRange(c.sumo.get(), c.root_states[0], c.root_states[3], lambda,
                                                            1, 1, 6, &accepted, nullptr, host));
            } else {
                EXPECT_TRUE(iterate(c.sumo.get(), lambda, &accepted, nullptr, host, 1));
            }
            lambda *= accepted ? 0.3 : 10.0;
        }
        std::vector<double> x;
        for (SumoStateVector *s : c.all())
            for (int i = 0; i < 2; ++i) x.push_back(s->x.v.data[i]);
        return x;
    };
    // Enough observations for real workers: a line through 3,000 points, some of them with
    // central differences, solved in one Gauss-Newton step.
    {
        auto fit_line = [](const ThreadHostInterface *host) {
            LineFit fit(false, host, 3000);
            for (SumoObs *o = fit.sumo->obs_active; o != nullptr && o->next != nullptr; o = o->next->next)
                o->numeric_jacobians = 1;
            EXPECT_TRUE(iterate(fit.sumo.get(), 0.0, nullptr, nullptr, host));
            return std::vector<double>{fit.line->x.v.data[0], fit.line->x.v.data[1],
                                       dSumoComputeResidual(fit.sumo.get(), 0, host)};
        };
        const std::vector<double> reference = fit_line(nullptr);
        for (uint32_t jobs : {1u, 2u, 5u}) {
            HostPtr host(plano_host_new(jobs));
            expect_close(fit_line(plano_host_interface(host.get())), reference, 1e-12, "line");
        }
    }
    // Accumulation order differs between job counts, and the central differences keep the
    // iteration from converging quadratically, so agreement is to rounding amplified a little;
    // a job seeing another's difference step would be off by about the step (1e-7).
    for (bool range : {false, true}) {
        const std::vector<double> reference = solve(nullptr, range);
        for (uint32_t jobs : {1u, 2u, 5u}) {
            HostPtr host(plano_host_new(jobs));
            const std::vector<double> x = solve(plano_host_interface(host.get()), range);
            ASSERT_EQ(x.size(), reference.size());
            for (size_t i = 0; i < x.size(); ++i)
                EXPECT_NEAR(x[i], reference[i], 1e-9 * (1.0 + std::abs(reference[i]))) << jobs << " jobs";
        }
    }
    vThreadedWorkerPoolFree();
}

TEST(SumoSolver, StateRangeEvaluationSameForAnyNumberOfJobs)
{
    // Jobs take contiguous index sub-ranges and their own accumulators; the result must be
    // what one thread makes, including what lands on states outside the run (an unset first
    // index asks for every Jacobian, so r2 receives r1's coupling).
    auto evaluate = [](const ThreadHostInterface *host) {
        Chain c(host);
        EXPECT_TRUE(bSumoSetStateIndices(c.sumo.get()));
        EXPECT_TRUE(bSumoResetInfoBranch(c.sumo.get(), c.sumo->root, kAll));
        uint32_t lo, hi;
        EXPECT_TRUE(bSumoGetIndexLimitsStateRange(c.root_states[1], c.root_states[3], &lo, &hi));
        EXPECT_TRUE(bSumoEvaluateObsStateRange(c.sumo.get(), c.root_states[1], c.root_states[3], lo, hi, host));
        std::vector<double> v = work_copies(c.sumo.get());
        EXPECT_TRUE(bSumoResetInfoBranch(c.sumo.get(), c.sumo->root, kAll));
        EXPECT_TRUE(bSumoEvaluateObsStateRange(c.sumo.get(), c.root_states[0], c.root_states[1], kAll, kAll, host));
        const std::vector<double> w = work_copies(c.sumo.get());
        v.insert(v.end(), w.begin(), w.end());
        EXPECT_TRUE(bSumoResetInfoBranch(c.sumo.get(), c.sumo->root, kAll));
        EXPECT_TRUE(bSumoEvaluateObsBranch(c.sumo.get(), c.sumo->root, kAll, kAll, host));
        const std::vector<double> u = work_copies(c.sumo.get());
        v.insert(v.end(), u.begin(), u.end());
        return v;
    };
    const std::vector<double> reference = evaluate(nullptr);
    for (uint32_t jobs : {1u, 2u, 5u}) {
        HostPtr host(plano_host_new(jobs));
        expect_close(evaluate(plano_host_interface(host.get())), reference, 1e-13, "jobs");
    }
    vThreadedWorkerPoolFree();
}

TEST(SumoSolver, CostCachedByTheIterationIsTheTotalCost)
{
    // The first iteration after a change takes the cost at the stored parameters from its
    // own linearisation; it must be the total cost, to the bit, whatever the job count.
    for (uint32_t jobs : {0u, 1u, 2u, 5u}) {
        HostPtr host(jobs ? plano_host_new(jobs) : nullptr);
        const ThreadHostInterface *iface = jobs ? plano_host_interface(host.get()) : nullptr;
        Chain c(iface);
        for (double lambda : {1e-2, 1e6}) {
            c.sumo->modified = 1;
            const double before = dSumoComputeResidual(c.sumo.get(), 0, iface);
            uint32_t accepted = 9;
            double reduction = -1.0;
            ASSERT_TRUE(iterate(c.sumo.get(), lambda, &accepted, &reduction, iface));
            const double after = dSumoComputeResidual(c.sumo.get(), 0, iface);
            EXPECT_EQ(c.sumo->modified, 0u);
            EXPECT_EQ(c.sumo->residual, after) << jobs << " jobs";
            if (accepted)
                EXPECT_EQ(reduction, before - after) << jobs << " jobs";
            else
                EXPECT_EQ(after, before) << jobs << " jobs";
        }
    }
    // Thousands of observations, split between real workers: the cost, whether summed on its
    // own or taken from the build, has one set of bits whatever the job count.
    double reference = 0.0;
    for (uint32_t jobs : {0u, 1u, 2u, 5u}) {
        HostPtr host(jobs ? plano_host_new(jobs) : nullptr);
        const ThreadHostInterface *iface = jobs ? plano_host_interface(host.get()) : nullptr;
        LineFit fit(false, iface, 3001);
        const double cost = dSumoComputeResidual(fit.sumo.get(), 0, iface);
        if (jobs == 0) reference = cost;
        EXPECT_EQ(cost, reference) << jobs << " jobs";
        fit.sumo->modified = 1;
        uint32_t accepted = 0;
        ASSERT_TRUE(iterate(fit.sumo.get(), 1e-3, &accepted, nullptr, iface));
        EXPECT_EQ(accepted, 1u);
        EXPECT_EQ(fit.sumo->residual, dSumoComputeResidual(fit.sumo.get(), 0, iface)) << jobs << " jobs";
    }
    vThreadedWorkerPoolFree();
}

// h = sum_i J_i x_i with fixed matrices, for states of any dimension.
struct LinearObs {
    std::vector<Eigen::MatrixXd> J;
};

Plx_Bool h_linear(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t n, const SumoVector *z, Plx_Vector *h,
                  Plx_Matrix **J)
{
    const auto *L = static_cast<const LinearObs *>(z->user_data);
    Eigen::VectorXd v = Eigen::VectorXd::Zero(z->v.rows);
    for (uint32_t i = 0; i < n; ++i) {
        v += L->J[i] * params(s[i]);
        if (J != nullptr && J[i] != nullptr)
            for (int r = 0; r < L->J[i].rows(); ++r)
                for (int c = 0; c < L->J[i].cols(); ++c) J[i]->data[r * L->J[i].cols() + c] = L->J[i](r, c);
    }
    for (uint32_t r = 0; r < z->v.rows; ++r) h->data[r] = v[r];
    return PLX_TRUE;
}

TEST(SumoSolver, InformationOfEveryBlockSizeMatchesTheDenseSums)
{
    // Dimensions with fixed-size kernels (2, 6, 9), without (5, 7) and beyond the stack
    // buffer (17); diagonal, scaled-identity and full information matrices.
    SumoPtr sumo(pSumoForm(nullptr, nullptr));
    std::mt19937 rng(3);
    std::uniform_real_distribution<double> u(-1.0, 1.0);
    std::vector<SumoStateVector *> st;
    for (uint32_t n : {2u, 5u, 9u, 17u, 6u, 7u}) {
        st.push_back(pSumoStateVectorNew(sumo.get(), sumo->root, n, nullptr, nullptr));
        Eigen::VectorXd x(n);
        for (uint32_t i = 0; i < n; ++i) x[i] = u(rng);
        Vec xv(x);
        ASSERT_TRUE(bSumoStateVectorInit(sumo.get(), st.back(), &xv.v));
    }
    const std::vector<std::vector<int>> links = {{0, 1}, {1, 2}, {2, 3}, {3, 4}, {4, 5}, {0, 5}, {1, 3, 5}, {2}};
    std::vector<std::unique_ptr<LinearObs>> data;
    int kind = 0;
    for (const auto &link : links) {
        const int m = 3 + kind % 2;
        auto L = std::make_unique<LinearObs>();
        std::vector<SumoStateVector *> obs_states;
        for (int i : link) {
            L->J.push_back(Eigen::MatrixXd::NullaryExpr(m, st[i]->x.v.rows, [&] { return u(rng); }));
            obs_states.push_back(st[i]);
        }
        Eigen::VectorXd z(m);
        for (int i = 0; i < m; ++i) z[i] = u(rng);
        Vec zv(z);
        std::unique_ptr<Squ> N;
        if (kind % 3 == 0) {
            N = std::make_unique<Squ>(m, 2.5);
        } else if (kind % 3 == 1) {
            N = std::make_unique<Squ>(Eigen::MatrixXd(Eigen::VectorXd::LinSpaced(m, 0.5, 3.0).asDiagonal()));
            N->m.type = PLX_SQUMAT_DIAGONAL;
            for (int i = 0; i < m; ++i) N->m.data[i] = 0.5 + 2.5 * i / (m - 1);
        } else {
            const Eigen::MatrixXd R = Eigen::MatrixXd::NullaryExpr(m, m, [&] { return u(rng); });
            N = std::make_unique<Squ>(Eigen::MatrixXd(R * R.transpose() + Eigen::MatrixXd::Identity(m, m)));
        }
        SumoObs *o = pSumoObsH(sumo.get(), &zv.v, &N->m, h_linear, nullptr, obs_states.data(),
                               uint32_t(obs_states.size()));
        ASSERT_NE(o, nullptr);
        o->z.user_data = L.get();
        data.push_back(std::move(L));
        ++kind;
    }
    ASSERT_TRUE(bSumoBuildInformationBlocksBranch(sumo.get(), sumo->root, 1, kAll, kAll, nullptr));
    const DenseSystem d = dense_system(sumo.get());
    for (SumoStateVector *s : st) {
        const int o = d.offset.at(s), n = int(s->x.v.rows);
        const Eigen::MatrixXd A = dense(s->A_work);
        EXPECT_LT((A - d.H.block(o, o, n, n)).norm(), 1e-12 * d.H.norm()) << "dimension " << n;
        EXPECT_EQ((A - A.transpose()).norm(), 0.0) << "dimension " << n;
        for (int i = 0; i < n; ++i) EXPECT_NEAR(s->b_work.data[i], d.g[o + i], 1e-12 * d.g.norm());
        for (SumoOffdiag *k = s->row_blocks; k != nullptr; k = k->row_next) {
            Eigen::MatrixXd M(k->M_work.rows, k->M_work.cols);
            for (uint32_t i = 0; i < k->M_work.rows; ++i)
                for (uint32_t j = 0; j < k->M_work.cols; ++j) M(i, j) = k->M_work.data[i * k->M_work.cols + j];
            EXPECT_LT((M - d.H.block(o, d.offset.at(k->col), M.rows(), M.cols())).norm(), 1e-12 * d.H.norm());
        }
    }
}

TEST(SumoSolver, StateRangeEntryPointsCheckTheirRun)
{
    // Every entry point on a run of states refuses a missing optimiser or state and a last
    // state that cannot be reached from the first, under its own name, and changes nothing.
    Chain c;
    ASSERT_TRUE(bSumoSetStateIndices(c.sumo.get()));
    SumoStateVector *a = c.root_states[1], *b = c.root_states[3];
    const Eigen::VectorXd kept = params(a);
    uint32_t f, l;
    int32_t code;
    using St = SumoStateVector;
    using Call = std::function<bool(Sumo *, St *, St *)>;
    const std::vector<std::pair<const char *, Call>> calls = {
        {"bSumoBuildInformationBlocksStateRange",
         [](Sumo *s, St *p, St *q) { return bSumoBuildInformationBlocksStateRange(s, p, q, 2, 6, nullptr) != 0; }},
        {"bSumoEvaluateObsStateRange",
         [](Sumo *s, St *p, St *q) { return bSumoEvaluateObsStateRange(s, p, q, 2, 6, nullptr) != 0; }},
        {"bSumoResetInfoStateRange",
         [](Sumo *s, St *p, St *q) { return bSumoResetInfoStateRange(s, p, q, kAll) != 0; }},
        {"bSumoCombineThreadedInfoStateRange",
         [](Sumo *s, St *p, St *q) { return bSumoCombineThreadedInfoStateRange(s, p, q, kAll, 0) != 0; }},
        {"bRecursiveEliminationStateRange",
         [&](Sumo *s, St *p, St *q) { return bRecursiveEliminationStateRange(s, p, q, 1, 0.0, 0, kAll, &code) != 0; }},
        {"bBackSubstitutionStateRange",
         [](Sumo *s, St *p, St *q) { return bBackSubstitutionStateRange(s, p, q, nullptr, 1, 2, 6) != 0; }},
        {"bIncrementParametersStateRange",
         [](Sumo *s, St *p, St *q) { return bIncrementParametersStateRange(s, p, q) != 0; }},
        {"bSumoReinstateOldParametersStateRange",
         [](Sumo *s, St *p, St *q) { return bSumoReinstateOldParametersStateRange(s, p, q) != 0; }},
        {"bAdjustInformationVectorStateRange",
         [](Sumo *s, St *p, St *q) { return bAdjustInformationVectorStateRange(s, p, q, 2, 6) != 0; }},
        {"dSumoComputeResidualStateRange",
         [](Sumo *s, St *p, St *q) {
             return dSumoComputeResidualStateRange(s, p, q, nullptr) != SUMO_FAILED_RESIDUAL;
         }},
        {"bSumoLevMarqIterationStateRange",
         [](Sumo *s, St *p, St *q) {
             return bSumoLevMarqIterationStateRange(s, p, q, 1.0, 0, 2, 6, nullptr, nullptr, nullptr) != 0;
         }},
        {"bSumoCreateOffdiagBlocksStateRange",
         [&](Sumo *s, St *p, St *q) { return bSumoCreateOffdiagBlocksStateRange(s, p, q, &f, &l) != 0; }},
    };
    Plx_ErrorRecord r;
    for (const auto &[name, call] : calls) {
        EXPECT_TRUE(fails_with(call(nullptr, a, b), PLX_ERROR_ILLEGAL_ARGUMENT)) << name;
        ASSERT_TRUE(plx_err_get_error(0, &r));
        EXPECT_STREQ(r.function, name);
        EXPECT_TRUE(fails_with(call(c.sumo.get(), a, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT)) << name;
        EXPECT_TRUE(fails_with(call(c.sumo.get(), b, a), PLX_ERROR_INCOMPATIBLE)) << name;
        ASSERT_TRUE(plx_err_get_error(0, &r));
        EXPECT_STREQ(r.function, name);
        EXPECT_EQ(params(a), kept) << name;
    }
    // The two without an optimiser argument check the run alike.
    EXPECT_TRUE(fails_with(bDampInformationMatrixStateRange(b, a, 1.0, 0), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(bSumoStoreParametersStateRange(nullptr, b, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
}

Plx_Bool h_cube(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *, Plx_Vector *h,
                Plx_Matrix **J)
{
    const double x = s[0]->x.v.data[0];
    h->data[0] = x * x * x;
    if (J != nullptr && J[0] != nullptr) J[0]->data[0] = 3.0 * x * x;
    return PLX_TRUE;
}

TEST(SumoSolver, RejectedStepsLeaveParametersExactly)
{
    SumoPtr sumo(pSumoForm(nullptr, nullptr));
    SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, 1, nullptr, nullptr);
    Vec x0{0.01};
    ASSERT_TRUE(bSumoStateVectorInit(sumo.get(), s, &x0.v));
    Vec z{1.0};
    Squ Ni(1, 1.0);
    ASSERT_NE(pSumoObsH_va(sumo.get(), &z.v, &Ni.m, h_cube, nullptr, s, nullptr), nullptr);
    // The undamped step overshoots by thousands: the cost rises and the step is undone.
    uint32_t accepted = 9;
    double reduction = 5.0;
    ASSERT_TRUE(iterate(sumo.get(), 0.0, &accepted, &reduction));
    EXPECT_EQ(accepted, 0u);
    EXPECT_EQ(reduction, 0.0);
    EXPECT_EQ(s->x.v.data[0], 0.01);
    // A state without information cannot be factored: rejected without an error.
    SumoStateVector *lonely = pSumoStateVectorNew(sumo.get(), sumo->root, 2, nullptr, nullptr);
    Vec x1{0.25, 0.5};
    ASSERT_TRUE(bSumoStateVectorInit(sumo.get(), lonely, &x1.v));
    plx_err_flush_trace();
    ASSERT_TRUE(iterate(sumo.get(), 1.0, &accepted, &reduction));
    EXPECT_EQ(accepted, 0u);
    EXPECT_EQ(plx_err_get_error_count(), 0u);
    EXPECT_EQ(s->x.v.data[0], 0.01);
    EXPECT_EQ(lonely->x.v.data[1], 0.5);
    // Additive damping makes it solvable; the cube then moves towards its root.
    ASSERT_TRUE(iterate(sumo.get(), 1.0, &accepted, &reduction, nullptr, SUMO_DAMP_ADDITIVE));
    EXPECT_EQ(accepted, 1u);
    EXPECT_GT(s->x.v.data[0], 0.01);
    EXPECT_EQ(lonely->x.v.data[1], 0.5);
}

TEST(SumoSolver, RelaxationConvergesToTheEliminationSolution)
{
    for (bool sor : {false, true}) {
        Chain c(nullptr, false);
        ASSERT_TRUE(bSumoSetStateIndices(c.sumo.get()));
        const DenseSystem d = dense_system(c.sumo.get());
        const auto step = c.dense_step();
        ASSERT_TRUE(bSumoRelaxationInitBranch(c.sumo.get(), c.sumo->root, kAll, kAll, nullptr));
        double previous = dSumoRelaxationResidualBranch(c.sumo.get(), c.sumo->root);
        EXPECT_NEAR(previous, d.g.squaredNorm(), 1e-9 * d.g.squaredNorm());
        for (int it = 0; it < 300; ++it) {
            ASSERT_TRUE(sor ? bSumoSORIterationBranch(c.sumo.get(), c.sumo->root, 1.2)
                            : bSumoGaussSeidelIterationBranch(c.sumo.get()));
            const double r = dSumoRelaxationResidualBranch(c.sumo.get(), c.sumo->root);
            if (it < 5) {
                EXPECT_LT(r, previous);
            }
            previous = r;
        }
        EXPECT_LT(previous, 1e-20);
        ASSERT_TRUE(bSumoRelaxationFinishBranch(c.sumo.get(), c.sumo->root, nullptr));
        c.expect_took(step);
        EXPECT_NEAR(c.sumo->residual, dSumoComputeResidual(c.sumo.get(), 0, nullptr), 1e-12);
    }
}

}  // namespace
