// One Levenberg-Marquardt iteration of the optimiser beside Ceres on the same problems, with
// the same starting point, damping and (where the shapes allow) the same elimination order:
//
// tracker: 4 homographies (9 parameters, a unit-norm observation each), each with a
//   2-parameter illumination state (gain, offset) hanging from it, and 20,000 observations
//   of 2x2 pixel blocks: gain * S(H p) + offset for a bilinear sample S of a smooth image.
//   Ceres: DENSE_SCHUR with the illumination states eliminated first, as ours does.
// chain: 2,000 affine states (6 parameters) linked by relative-motion observations with a
//   prior on the first; states older than a window of 50 are eliminated as they fall out, so
//   the iteration runs on the window and the marginal prior left on its oldest state.
//   Ceres: the window and that prior as a residual, SPARSE_NORMAL_CHOLESKY.
//
// Every timed iteration starts from the same parameters with no cached cost, so both sides
// evaluate the cost, linearise, solve, step and evaluate the new cost. Ceres' figure is one
// Solve with one iteration, its set-up included. Multiplicative damping lambda matches
// Ceres' LM with Jacobi scaling off and a trust region radius of 1 / lambda.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "plano_host/host.h"
#include "ratio_reporter.hpp"

#ifdef PLANO_HAVE_CERES
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wpedantic"
#pragma GCC diagnostic ignored "-Wunused-parameter"
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
#include <ceres/ceres.h>
#pragma GCC diagnostic pop
#endif

namespace {

constexpr double kLambda = 1e-3;

// ---------------------------------------------------------------- tracker-shaped problem

constexpr int kImage = 1024;
constexpr int kRegions = 4;
constexpr int kBlocksX = 50, kBlocksY = 100;  // 5,000 blocks of 2x2 pixels per region
constexpr double kPixelsPerUnit = 100.0;      // region coordinates to image pixels
constexpr double kPixelInfo = 100.0;          // 1 / sigma^2 of a pixel

// A smooth synthetic plate, sampled bilinearly with its analytic gradient.
struct Plate {
    std::vector<float> v;
    Plate() : v(std::size_t(kImage) * kImage)
    {
        for (int y = 0; y < kImage; ++y)
            for (int x = 0; x < kImage; ++x)
                v[std::size_t(y) * kImage + x] =
                    float(0.5 + 0.2 * std::sin(x / 7.0) * std::cos(y / 9.0) + 0.1 * std::sin((x + 2.0 * y) / 23.0));
    }
    // S(x, y) and its gradient (clamped inside the image).
    double sample(double x, double y, double *gx, double *gy) const
    {
        x = std::clamp(x, 0.0, kImage - 1.001);
        y = std::clamp(y, 0.0, kImage - 1.001);
        const int ix = int(x), iy = int(y);
        const double fx = x - ix, fy = y - iy;
        const float *r0 = &v[std::size_t(iy) * kImage + ix];
        const float *r1 = r0 + kImage;
        const double a = r0[0], b = r0[1], c = r1[0], d = r1[1];
        *gx = (1 - fy) * (b - a) + fy * (d - c);
        *gy = (1 - fx) * (c - a) + fx * (d - b);
        return (1 - fy) * ((1 - fx) * a + fx * b) + fy * ((1 - fx) * c + fx * d);
    }
};

const Plate &plate()
{
    static const Plate p;
    return p;
}

// One observation: a 2x2 block whose top-left corner is (u, v) in region coordinates, in the
// region centred on (cx, cy) image pixels.
struct Block {
    double u, v, cx, cy;
};
constexpr int kBlockPixels = 4;
constexpr double kStep = 1.0 / kPixelsPerUnit;

// Prediction of a block and its Jacobians (row-major, 4 x 9 and 4 x 2; null when unwanted).
void predict_block(const double *H, const double *g, const Block &blk, double *pred, double *JH, double *Jg)
{
    const Plate &S = plate();
    for (int k = 0; k < kBlockPixels; ++k) {
        const double p[3] = {blk.u + (k & 1) * kStep, blk.v + (k >> 1) * kStep, 1.0};
        const double x = H[0] * p[0] + H[1] * p[1] + H[2];
        const double y = H[3] * p[0] + H[4] * p[1] + H[5];
        const double w = H[6] * p[0] + H[7] * p[1] + H[8];
        const double iw = 1.0 / w;
        double sx, sy;
        const double s = S.sample(blk.cx + kPixelsPerUnit * x * iw, blk.cy + kPixelsPerUnit * y * iw, &sx, &sy);
        pred[k] = g[0] * s + g[1];
        if (JH != nullptr) {
            const double ax = g[0] * sx * kPixelsPerUnit * iw, ay = g[0] * sy * kPixelsPerUnit * iw;
            double *j = JH + 9 * k;
            for (int c = 0; c < 3; ++c) {
                j[c] = ax * p[c];
                j[3 + c] = ay * p[c];
                j[6 + c] = -(ax * x + ay * y) * iw * p[c];
            }
        }
        if (Jg != nullptr) {
            Jg[2 * k] = s;
            Jg[2 * k + 1] = 1.0;
        }
    }
}

// Data shared by both sides: blocks, measurements and the starting parameters.
struct TrackerData {
    std::vector<Block> blocks;             // region r owns blocks [r * n, (r + 1) * n)
    std::vector<std::array<double, 4>> z;  // measured intensities
    std::array<std::array<double, 9>, kRegions> H0;
    std::array<std::array<double, 2>, kRegions> g0;
};

void normalise(double *H)
{
    double ss = 0.0;
    for (int i = 0; i < 9; ++i) ss += H[i] * H[i];
    for (int i = 0; i < 9; ++i) H[i] /= std::sqrt(ss);
}

const TrackerData &tracker_data()
{
    static const TrackerData data = [] {
        TrackerData d;
        std::mt19937 rng(5);
        std::normal_distribution<double> noise(0.0, 0.01);
        std::uniform_real_distribution<double> jitter(-1.0, 1.0);
        for (int r = 0; r < kRegions; ++r) {
            const double cx = 256.0 + 512.0 * (r & 1), cy = 256.0 + 512.0 * (r >> 1);
            // The true motion: a slight projective warp; the start is off by a pixel or two.
            double Ht[9] = {1.0 + 0.02 * r, 0.03, 0.01, -0.02, 0.98, -0.015, 0.02, -0.01, 1.0};
            normalise(Ht);
            const double gt[2] = {1.1, 0.05};
            for (int by = 0; by < kBlocksY; ++by)
                for (int bx = 0; bx < kBlocksX; ++bx) {
                    const Block blk{-0.5 + 2.0 * kStep * bx, -1.0 + 2.0 * kStep * by, cx, cy};
                    std::array<double, 4> z;
                    predict_block(Ht, gt, blk, z.data(), nullptr, nullptr);
                    for (double &v : z) v += noise(rng);
                    d.blocks.push_back(blk);
                    d.z.push_back(z);
                }
            for (int i = 0; i < 9; ++i) d.H0[r][i] = Ht[i] + 0.004 * jitter(rng);
            normalise(d.H0[r].data());
            d.g0[r] = {1.0, 0.0};
        }
        return d;
    }();
    return data;
}

Plx_Bool h_block(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *z, Plx_Vector *h,
                 Plx_Matrix **J)
{
    const Block &blk = *static_cast<const Block *>(z->user_data);
    predict_block(s[0]->x.v.data, s[1]->x.v.data, blk, h->data, J != nullptr && J[0] != nullptr ? J[0]->data : nullptr,
                  J != nullptr && J[1] != nullptr ? J[1]->data : nullptr);
    return PLX_TRUE;
}

// The homography's free scale: the sum of squares of its entries, observed as 1.
Plx_Bool h_unit_norm(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *, Plx_Vector *h,
                     Plx_Matrix **J)
{
    const double *x = s[0]->x.v.data;
    double ss = 0.0;
    for (int i = 0; i < 9; ++i) ss += x[i] * x[i];
    h->data[0] = ss;
    if (J != nullptr && J[0] != nullptr)
        for (int i = 0; i < 9; ++i) J[0]->data[i] = 2.0 * x[i];
    return PLX_TRUE;
}

// The optimiser side of a problem: the model, its states and their starting parameters
// (and starting prior vectors, which an accepted step moves).
struct Model {
    Sumo *sumo = nullptr;
    std::vector<SumoStateVector *> states;  // the states an iteration changes
    std::vector<std::vector<double>> x0, b0;
    ~Model() { vSumoFree(sumo, nullptr); }
    void save()
    {
        x0.clear();
        b0.clear();
        for (SumoStateVector *s : states) {
            x0.emplace_back(s->x.v.data, s->x.v.data + s->x.v.rows);
            b0.emplace_back(s->b.data, s->b.data + s->x.v.rows);
        }
    }
    void restore()
    {
        for (std::size_t i = 0; i < states.size(); ++i) {
            std::memcpy(states[i]->x.v.data, x0[i].data(), sizeof(double) * x0[i].size());
            std::memcpy(states[i]->b.data, b0[i].data(), sizeof(double) * b0[i].size());
        }
        sumo->modified = 1;  // the cost at the start is evaluated again, as Ceres does
    }
};

std::unique_ptr<Model> tracker_model(const ThreadHostInterface *host)
{
    const TrackerData &d = tracker_data();
    auto m = std::make_unique<Model>();
    m->sumo = pSumoForm(nullptr, host);
    Plx_Vector z{}, one{};
    Plx_SquMatrix Ni{}, Ni1{};
    plx_vec_form(&z, kBlockPixels);
    plx_vec_form(&one, 1);
    one.data[0] = 1.0;
    plx_squmat_form(&Ni, PLX_SQUMAT_SCALED_IDENTITY, kBlockPixels);
    Ni.data[0] = kPixelInfo;
    plx_squmat_form(&Ni1, PLX_SQUMAT_SCALED_IDENTITY, 1);
    Ni1.data[0] = 1e4;
    const std::size_t per_region = d.blocks.size() / kRegions;
    for (int r = 0; r < kRegions; ++r) {
        SumoStateVector *H = pSumoStateVectorNew(m->sumo, m->sumo->root, 9, nullptr, host);
        SumoStateVector *g = pSumoStateVectorNew(m->sumo, pSumoBranchNewFromState(m->sumo, H), 2, nullptr, host);
        Plx_Vector x{};
        plx_vec_form_data(&x, 9, const_cast<double *>(d.H0[r].data()));
        bSumoStateVectorInit(m->sumo, H, &x);
        plx_vec_form_data(&x, 2, const_cast<double *>(d.g0[r].data()));
        bSumoStateVectorInit(m->sumo, g, &x);
        SumoStateVector *pair[2] = {H, g};
        pSumoObsH(m->sumo, &one, &Ni1, h_unit_norm, nullptr, pair, 1);
        for (std::size_t i = r * per_region; i < (r + 1) * per_region; ++i) {
            std::memcpy(z.data, d.z[i].data(), sizeof(double) * kBlockPixels);
            SumoObs *o = pSumoObsH(m->sumo, &z, &Ni, h_block, nullptr, pair, 2);
            o->z.user_data = const_cast<Block *>(&d.blocks[i]);
        }
        m->states.push_back(H);
        m->states.push_back(g);
    }
    plx_vec_free(&z);
    plx_vec_free(&one);
    plx_squmat_free(&Ni);
    plx_squmat_free(&Ni1);
    m->save();
    return m;
}

// ---------------------------------------------------------------- chain-shaped problem

constexpr int kChain = 2000, kWindow = 50;
constexpr double kMotionInfo = 1e4, kPriorInfo = 1e6;

// h(a, b) = a^-1 b for affine motions a = [L | t] stored row-major as 2 x 3, with its
// Jacobians (6 x 6 each, null when unwanted).
void relative_motion(const double *a, const double *b, double *h, double *Ja, double *Jb)
{
    const double det = a[0] * a[4] - a[1] * a[3];
    const double P[4] = {a[4] / det, -a[1] / det, -a[3] / det, a[0] / det};  // L_a^-1
    const double B[6] = {b[0], b[1], b[2] - a[2], b[3], b[4], b[5] - a[5]};
    for (int r = 0; r < 2; ++r)
        for (int c = 0; c < 3; ++c) h[3 * r + c] = P[2 * r] * B[c] + P[2 * r + 1] * B[3 + c];
    if (Jb != nullptr) {
        std::memset(Jb, 0, sizeof(double) * 36);
        for (int r = 0; r < 2; ++r)
            for (int c = 0; c < 3; ++c)
                for (int k = 0; k < 2; ++k) Jb[(3 * r + c) * 6 + 3 * k + c] = P[2 * r + k];
    }
    if (Ja != nullptr) {
        // d(L^-1 B) = -L^-1 dL (L^-1 B) + L^-1 dB, with dB = [0 | -dt].
        for (int r = 0; r < 2; ++r)
            for (int c = 0; c < 3; ++c) {
                double *row = Ja + (3 * r + c) * 6;
                for (int k = 0; k < 2; ++k) {
                    for (int l = 0; l < 2; ++l) row[3 * k + l] = -P[2 * r + k] * h[3 * l + c];
                    row[3 * k + 2] = c == 2 ? -P[2 * r + k] : 0.0;
                }
            }
    }
}

Plx_Bool h_relative(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *, Plx_Vector *h,
                    Plx_Matrix **J)
{
    relative_motion(s[0]->x.v.data, s[1]->x.v.data, h->data, J != nullptr && J[0] != nullptr ? J[0]->data : nullptr,
                    J != nullptr && J[1] != nullptr ? J[1]->data : nullptr);
    return PLX_TRUE;
}

Plx_Bool h_direct(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *, Plx_Vector *h,
                  Plx_Matrix **J)
{
    std::memcpy(h->data, s[0]->x.v.data, sizeof(double) * 6);
    if (J != nullptr && J[0] != nullptr) {
        std::memset(J[0]->data, 0, sizeof(double) * 36);
        for (int i = 0; i < 6; ++i) J[0]->data[7 * i] = 1.0;
    }
    return PLX_TRUE;
}

struct ChainData {
    std::vector<std::array<double, 6>> x0, z;  // starting states; z[i] links i and i + 1
};

const ChainData &chain_data()
{
    static const ChainData data = [] {
        ChainData d;
        std::mt19937 rng(9);
        std::normal_distribution<double> noise(0.0, 0.01);
        std::vector<std::array<double, 6>> truth(kChain);
        truth[0] = {1, 0, 0, 0, 1, 0};
        for (int i = 1; i < kChain; ++i) {
            const double t = 0.01 * i;
            truth[i] = {1.0 + 0.05 * std::sin(t), 0.05 * std::cos(1.3 * t), 3.0 * t,
                        -0.04 * std::sin(0.7 * t), 1.0 + 0.03 * std::cos(t), 2.0 * std::sin(t)};
        }
        for (int i = 0; i < kChain; ++i) {
            std::array<double, 6> x = truth[i];
            for (double &v : x) v += noise(rng);
            d.x0.push_back(x);
            if (i + 1 < kChain) {
                std::array<double, 6> z;
                relative_motion(truth[i].data(), truth[i + 1].data(), z.data(), nullptr, nullptr);
                for (double &v : z) v += 0.1 * noise(rng);
                d.z.push_back(z);
            }
        }
        return d;
    }();
    return data;
}

// Builds the chain as a sliding window would: each new state is linked to the previous one,
// the window takes one Gauss-Newton step, and the oldest state leaves the window by full
// elimination. The returned model holds the window (its states' starting parameters saved).
std::unique_ptr<Model> chain_model(const ThreadHostInterface *host)
{
    const ChainData &d = chain_data();
    auto m = std::make_unique<Model>();
    m->sumo = pSumoForm(nullptr, host);
    SumoWorkspace *ws = pSumoWorkspaceForm(nullptr);
    Plx_Vector z{}, x{};
    Plx_SquMatrix Nm{}, Np{};
    plx_vec_form(&z, 6);
    plx_squmat_form(&Nm, PLX_SQUMAT_SCALED_IDENTITY, 6);
    Nm.data[0] = kMotionInfo;
    plx_squmat_form(&Np, PLX_SQUMAT_SCALED_IDENTITY, 6);
    Np.data[0] = kPriorInfo;
    std::vector<SumoStateVector *> window;
    for (int i = 0; i < kChain; ++i) {
        SumoStateVector *s = pSumoStateVectorNew(m->sumo, m->sumo->root, 6, nullptr, host);
        plx_vec_form_data(&x, 6, const_cast<double *>(d.x0[i].data()));
        bSumoStateVectorInit(m->sumo, s, &x);
        if (i == 0) {
            SumoStateVector *one[1] = {s};
            pSumoObsH(m->sumo, &x, &Np, h_direct, nullptr, one, 1);
        } else {
            std::memcpy(z.data, d.z[i - 1].data(), sizeof(double) * 6);
            SumoStateVector *pair[2] = {window.back(), s};
            pSumoObsH(m->sumo, &z, &Nm, h_relative, nullptr, pair, 2);
        }
        window.push_back(s);
        if (window.size() > std::size_t(kWindow)) {
            bSumoStateEliminate(m->sumo, ws, window.front(), SUMO_ADJUST_FULL, host);
            window.erase(window.begin());
        }
        bSumoLevMarqIterationBranchGen(m->sumo, m->sumo->root, nullptr, 1, 0.0, SUMO_DAMP_MULTIPLICATIVE,
                                       SUMO_UNSET_INDEX, SUMO_UNSET_INDEX, nullptr, nullptr, host);
    }
    plx_vec_free(&z);
    plx_squmat_free(&Nm);
    plx_squmat_free(&Np);
    vSumoWorkspaceFree(ws);
    // The window as a new frame finds it: away from its optimum, as a prediction would be.
    std::mt19937 rng(13);
    std::normal_distribution<double> jolt(0.0, 0.01);
    for (SumoStateVector *s : window)
        for (int i = 0; i < 6; ++i) s->x.v.data[i] += jolt(rng);
    m->states = window;
    m->save();
    return m;
}

// ---------------------------------------------------------------- our iteration

enum Shape { kTracker = 0, kChainShape = 1 };

std::string label(const char *who, int shape, int jobs)
{
    return std::string(who) + (shape == kTracker ? "/tracker" : "/chain") + "/jobs" + std::to_string(jobs);
}

void BM_Sumo(benchmark::State &state)
{
    const int shape = int(state.range(0)), jobs = int(state.range(1));
    PlanoHost *host = plano_host_new(uint32_t(jobs));
    const ThreadHostInterface *iface = plano_host_interface(host);
    std::unique_ptr<Model> m = shape == kTracker ? tracker_model(iface) : chain_model(iface);
    uint32_t accepted = 0;
    for (auto _ : state) {
        m->restore();
        if (!bSumoLevMarqIterationBranchGen(m->sumo, m->sumo->root, nullptr, 1, kLambda, SUMO_DAMP_MULTIPLICATIVE,
                                            SUMO_UNSET_INDEX, SUMO_UNSET_INDEX, &accepted, nullptr, iface)) {
            state.SkipWithError("iteration failed");
            break;
        }
    }
    state.counters["accepted"] = accepted;
    m.reset();
    plano_host_free(host);
    state.SetLabel(label("plano", shape, jobs));
}

#ifdef PLANO_HAVE_CERES
// ---------------------------------------------------------------- Ceres

class BlockCost : public ceres::SizedCostFunction<kBlockPixels, 9, 2> {
public:
    BlockCost(const Block *blk, const double *z) : blk_(blk), z_(z) {}
    bool Evaluate(double const *const *p, double *residuals, double **jacobians) const override
    {
        const double w = std::sqrt(kPixelInfo);
        predict_block(p[0], p[1], *blk_, residuals, jacobians != nullptr ? jacobians[0] : nullptr,
                      jacobians != nullptr ? jacobians[1] : nullptr);
        for (int k = 0; k < kBlockPixels; ++k) residuals[k] = w * (residuals[k] - z_[k]);
        if (jacobians != nullptr)
            for (int i = 0; i < 2; ++i)
                if (jacobians[i] != nullptr)
                    for (int k = 0; k < kBlockPixels * (i == 0 ? 9 : 2); ++k) jacobians[i][k] *= w;
        return true;
    }

private:
    const Block *blk_;
    const double *z_;
};

class UnitNormCost : public ceres::SizedCostFunction<1, 9> {
public:
    bool Evaluate(double const *const *p, double *residuals, double **jacobians) const override
    {
        double ss = 0.0;
        for (int i = 0; i < 9; ++i) ss += p[0][i] * p[0][i];
        residuals[0] = 100.0 * (ss - 1.0);
        if (jacobians != nullptr && jacobians[0] != nullptr)
            for (int i = 0; i < 9; ++i) jacobians[0][i] = 200.0 * p[0][i];
        return true;
    }
};

class RelativeCost : public ceres::SizedCostFunction<6, 6, 6> {
public:
    explicit RelativeCost(const double *z) : z_(z) {}
    bool Evaluate(double const *const *p, double *residuals, double **jacobians) const override
    {
        const double w = std::sqrt(kMotionInfo);
        relative_motion(p[0], p[1], residuals, jacobians != nullptr ? jacobians[0] : nullptr,
                        jacobians != nullptr ? jacobians[1] : nullptr);
        for (int k = 0; k < 6; ++k) residuals[k] = w * (residuals[k] - z_[k]);
        if (jacobians != nullptr)
            for (int i = 0; i < 2; ++i)
                if (jacobians[i] != nullptr)
                    for (int k = 0; k < 36; ++k) jacobians[i][k] *= w;
        return true;
    }

private:
    const double *z_;
};

// The marginal prior (information A, vector b at the point x0, cost dx^T A dx - 2 b^T dx)
// as the residual L^T (x - x0) - L^-1 b with A = L L^T.
class PriorCost : public ceres::SizedCostFunction<6, 6> {
public:
    PriorCost(const double *A, const double *b, const double *x0)
    {
        Eigen::Map<const Eigen::Matrix<double, 6, 6, Eigen::RowMajor>> a(A);
        const Eigen::Matrix<double, 6, 6> L = a.llt().matrixL();
        Lt_ = L.transpose();
        offset_ = L.triangularView<Eigen::Lower>().solve(Eigen::Map<const Eigen::Matrix<double, 6, 1>>(b));
        x0_ = Eigen::Map<const Eigen::Matrix<double, 6, 1>>(x0);
    }
    bool Evaluate(double const *const *p, double *residuals, double **jacobians) const override
    {
        const Eigen::Map<const Eigen::Matrix<double, 6, 1>> x(p[0]);
        Eigen::Map<Eigen::Matrix<double, 6, 1>> r(residuals);
        r = Lt_ * (x - x0_) - offset_;
        if (jacobians != nullptr && jacobians[0] != nullptr) {
            Eigen::Map<Eigen::Matrix<double, 6, 6, Eigen::RowMajor>> J(jacobians[0]);
            J = Lt_;
        }
        return true;
    }

private:
    Eigen::Matrix<double, 6, 6> Lt_;
    Eigen::Matrix<double, 6, 1> offset_, x0_;
};

struct CeresSide {
    ceres::Problem problem;
    std::vector<std::vector<double>> params, start;
    ceres::Solver::Options options;
    ceres::ParameterBlockOrdering *ordering = nullptr;
};

std::unique_ptr<CeresSide> ceres_tracker(int jobs)
{
    const TrackerData &d = tracker_data();
    auto c = std::make_unique<CeresSide>();
    for (int r = 0; r < kRegions; ++r) {
        c->params.emplace_back(d.H0[r].begin(), d.H0[r].end());
        c->params.emplace_back(d.g0[r].begin(), d.g0[r].end());
    }
    c->options.linear_solver_type = ceres::DENSE_SCHUR;
    auto *ordering = new ceres::ParameterBlockOrdering;
    const std::size_t per_region = d.blocks.size() / kRegions;
    for (int r = 0; r < kRegions; ++r) {
        double *H = c->params[2 * r].data(), *g = c->params[2 * r + 1].data();
        c->problem.AddResidualBlock(new UnitNormCost, nullptr, H);
        for (std::size_t i = r * per_region; i < (r + 1) * per_region; ++i)
            c->problem.AddResidualBlock(new BlockCost(&d.blocks[i], d.z[i].data()), nullptr, H, g);
        ordering->AddElementToGroup(g, 0);  // illumination first, as it hangs from its homography
        ordering->AddElementToGroup(H, 1);
    }
    c->options.linear_solver_ordering.reset(ordering);
    c->options.num_threads = jobs;
    c->start = c->params;
    return c;
}

std::unique_ptr<CeresSide> ceres_chain(int jobs)
{
    // The window and its prior exactly as the optimiser holds them after the sliding build.
    std::unique_ptr<Model> m = chain_model(nullptr);
    auto c = std::make_unique<CeresSide>();
    for (SumoStateVector *s : m->states) c->params.emplace_back(s->x.v.data, s->x.v.data + 6);
    static std::vector<std::array<double, 6>> z;  // kept for the cost functions
    z.clear();
    z.reserve(m->states.size());
    for (std::size_t i = 0; i + 1 < m->states.size(); ++i) {
        const SumoObs *o = m->states[i]->obs_active;
        while (o != nullptr && !(o->n_states == 2 && o->states[0] == m->states[i]))
            o = o->next_in_state[o->states[0] == m->states[i] ? 0 : 1];
        std::array<double, 6> zi;
        std::memcpy(zi.data(), o->z.v.data, sizeof(double) * 6);
        z.push_back(zi);
        c->problem.AddResidualBlock(new RelativeCost(z.back().data()), nullptr, c->params[i].data(),
                                    c->params[i + 1].data());
    }
    SumoStateVector *oldest = m->states.front();
    c->problem.AddResidualBlock(new PriorCost(oldest->A.data, oldest->b.data, oldest->x.v.data), nullptr,
                                c->params[0].data());
    c->options.linear_solver_type = ceres::SPARSE_NORMAL_CHOLESKY;
    c->options.num_threads = jobs;
    c->start = c->params;
    return c;
}

// Largest difference between the parameters after one of our iterations and after Ceres'
// (both from the start): a check that the two sides solve the same damped system.
double step_difference(int shape, const CeresSide &c)
{
    std::unique_ptr<Model> m = shape == kTracker ? tracker_model(nullptr) : chain_model(nullptr);
    m->restore();
    uint32_t accepted = 0;
    bSumoLevMarqIterationBranchGen(m->sumo, m->sumo->root, nullptr, 1, kLambda, SUMO_DAMP_MULTIPLICATIVE,
                                   SUMO_UNSET_INDEX, SUMO_UNSET_INDEX, &accepted, nullptr, nullptr);
    double d = 0.0;
    for (std::size_t i = 0; i < m->states.size(); ++i)
        for (std::size_t j = 0; j < c.params[i].size(); ++j)
            d = std::max(d, std::abs(m->states[i]->x.v.data[j] - c.params[i][j]));
    return d;
}

void BM_Ceres(benchmark::State &state)
{
    const int shape = int(state.range(0)), jobs = int(state.range(1));
    std::unique_ptr<CeresSide> c = shape == kTracker ? ceres_tracker(jobs) : ceres_chain(jobs);
    c->options.max_num_iterations = 1;
    c->options.minimizer_type = ceres::TRUST_REGION;
    c->options.trust_region_strategy_type = ceres::LEVENBERG_MARQUARDT;
    c->options.initial_trust_region_radius = 1.0 / kLambda;
    c->options.jacobi_scaling = false;
    c->options.logging_type = ceres::SILENT;
    c->options.function_tolerance = 0.0;
    c->options.gradient_tolerance = 0.0;
    c->options.parameter_tolerance = 0.0;
    std::string why;
    if (!c->options.IsValid(&why)) {
        state.SkipWithError(why.c_str());
        return;
    }
    ceres::Solver::Summary summary;
    for (auto _ : state) {
        for (std::size_t i = 0; i < c->params.size(); ++i)
            std::copy(c->start[i].begin(), c->start[i].end(), c->params[i].begin());
        ceres::Solve(c->options, &c->problem, &summary);
    }
    state.counters["accepted"] = summary.num_successful_steps > 1 ? 1 : 0;
    state.counters["step_diff"] = step_difference(shape, *c);
    state.SetLabel(label("ceres", shape, jobs));
}
#endif

void arguments(benchmark::internal::Benchmark *b)
{
    for (int shape : {kTracker, kChainShape})
        for (int jobs : {1, 2}) b->Args({shape, jobs});
    b->Unit(benchmark::kMillisecond)->UseRealTime()->Repetitions(5)->ReportAggregatesOnly(true);
}

BENCHMARK(BM_Sumo)->Apply(arguments);
#ifdef PLANO_HAVE_CERES
BENCHMARK(BM_Ceres)->Apply(arguments);
#endif

}  // namespace

int main(int argc, char **argv)
{
    benchmark::Initialize(&argc, argv);
    RatioReporter reporter("ceres", 16, 3);
    benchmark::RunSpecifiedBenchmarks(&reporter);
    vThreadedWorkerPoolFree();
    benchmark::Shutdown();
    return 0;
}
