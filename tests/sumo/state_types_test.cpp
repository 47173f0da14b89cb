// The optimiser's standard state types: parameterisations, analytic Jacobians against central
// differences, the fixed and minimal variants, failures, and small solves through them.
#include <array>
#include <functional>
#include <string>

#include "plano/sumo_states.h"
#include "sumo_test_util.hpp"

using namespace sumo_test;

namespace {

constexpr uint32_t kAll = 0xFFFFFFFFu;

struct Model {
    SumoPtr sumo{pSumoForm(nullptr, nullptr)};
    WorkspacePtr ws{pSumoWorkspaceForm(nullptr)};
    SumoStateVector *state(uint32_t n = 0)
    {
        SumoStateVector *s = pSumoStateVectorNew(sumo.get(), sumo->root, n, nullptr, nullptr);
        EXPECT_NE(s, nullptr);
        return s;
    }
};

Eigen::MatrixXd to_eigen(const Plx_Matrix &m)
{
    Eigen::MatrixXd e(m.rows, m.cols);
    for (uint32_t r = 0; r < m.rows; ++r)
        for (uint32_t c = 0; c < m.cols; ++c) e(r, c) = m.data[r * m.cols + c];
    return e;
}

// A value of the state's object and, when J is given, its Jacobian with respect to the
// state's parameters as the type's fillers give it.
using Value = std::function<Eigen::VectorXd(const SumoStateVector *, Eigen::MatrixXd *)>;

// The analytic Jacobian against central differences over the parameters.
void expect_jacobian(SumoStateVector *s, const Value &g, const char *what)
{
    SCOPED_TRACE(what);
    Eigen::MatrixXd J;
    const Eigen::VectorXd g0 = g(s, &J);
    const uint32_t n = s->x.v.rows;
    ASSERT_EQ(J.rows(), g0.size());
    ASSERT_EQ(J.cols(), int(n));
    const double d = 1e-6;
    for (uint32_t k = 0; k < n; ++k) {
        const double saved = s->x.v.data[k];
        s->x.v.data[k] = saved + d;
        const Eigen::VectorXd plus = g(s, nullptr);
        s->x.v.data[k] = saved - d;
        const Eigen::VectorXd minus = g(s, nullptr);
        s->x.v.data[k] = saved;
        const Eigen::VectorXd numeric = (plus - minus) / (2 * d);
        for (int r = 0; r < g0.size(); ++r)
            EXPECT_NEAR(J(r, k), numeric[r], 1e-6 * (1 + std::abs(numeric[r]))) << "row " << r << " column " << k;
    }
}

// Fills J through a filler of the Plx_Matrix kind.
template <class F>
void filled(Eigen::MatrixXd *J, F &&fill)
{
    if (J == nullptr) return;
    Plx_Matrix m;
    plx_mat_form(&m, 1, 1);
    EXPECT_TRUE(fill(&m));
    *J = to_eigen(m);
    plx_mat_free(&m);
}

Plx_Matrix33 mat33(std::initializer_list<double> v)
{
    Plx_Matrix33 H;
    auto it = v.begin();
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) H.m[r][c] = *it++;
    return H;
}

Eigen::Matrix3d eig(const Plx_Matrix33 &H)
{
    Eigen::Matrix3d e;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) e(r, c) = H.m[r][c];
    return e;
}

const Plx_Matrix33 kH = mat33({1.2, 0.1, 3.0, -0.2, 0.9, -1.0, 0.01, 0.02, 1.1});

// ---- Jacobians of every type ----

TEST(SumoStatesJacobian, EveryTypeAgainstCentralDifferences)
{
    Model m;
    // Each case: a state of one type and a value of its object through the type's fillers.
    std::vector<std::pair<SumoStateVector *, Value>> cases;
    auto add = [&](uint32_t n, const std::function<Plx_Bool(SumoStateVector *)> &init, const Value &g, int32_t type) {
        SumoStateVector *s = m.state(n);
        ASSERT_TRUE(init(s));
        ASSERT_EQ(s->x.type, type);
        cases.emplace_back(s, g);
    };
    Sumo *sumo = m.sumo.get();

    // Transfer of a point, scaled by 1.5 through the filler: d(q0/q2, q1/q2)/dH.
    const Eigen::Vector3d p(0.4, -0.7, 1.0);
    const Value transfer = [&](const SumoStateVector *s, Eigen::MatrixXd *J) {
        Plx_Matrix33 H;
        EXPECT_TRUE(bSumoHomog33Read(s, &H));
        const Eigen::Vector3d q = eig(H) * p;
        double d[18] = {};
        for (int i = 0; i < 3; ++i) {
            d[i] = p[i] / q[2];
            d[6 + i] = -q[0] / (q[2] * q[2]) * p[i];
            d[9 + 3 + i] = p[i] / q[2];
            d[9 + 6 + i] = -q[1] / (q[2] * q[2]) * p[i];
        }
        filled(J, [&](Plx_Matrix *o) { return bSumoHomog33FillJacobian2(o, d, 1.5, s->x.type); });
        return Eigen::Vector2d(1.5 * q[0] / q[2], 1.5 * q[1] / q[2]).eval();
    };
    add(9, [&](SumoStateVector *s) { return bSumoHomog33Init(sumo, s, &kH); }, transfer, 4097);
    for (int k = 0; k < 9; ++k) {
        // Every minimal code: move the largest entry to k.
        Plx_Matrix33 H = kH;
        H.m[k / 3][k % 3] = 5.0;
        add(8, [&](SumoStateVector *s) { return bSumoHomog33InitMinimal(sumo, s, &H); }, transfer, 4099 + k);
    }
    // Affine: 1.5 A p with rows (x, y, 1, 0, 0, 0) and (0, 0, 0, x, y, 1).
    const Value affine = [&](const SumoStateVector *s, Eigen::MatrixXd *J) {
        Plx_Matrix23 A;
        EXPECT_TRUE(bSumoAffHomog33Read(s, &A));
        const double d[12] = {p[0], p[1], 1, 0, 0, 0, 0, 0, 0, p[0], p[1], 1};
        filled(J, [&](Plx_Matrix *o) { return bSumoAffHomog33FillJacobian2(o, d, 1.5, s->x.type); });
        return Eigen::Vector2d(1.5 * (A.m[0][0] * p[0] + A.m[0][1] * p[1] + A.m[0][2]),
                               1.5 * (A.m[1][0] * p[0] + A.m[1][1] * p[1] + A.m[1][2]))
            .eval();
    };
    const Plx_Matrix23 A = {{{1.1, 0.2, 3.0}, {-0.3, 0.8, -2.0}}};
    add(6, [&](SumoStateVector *s) { return bSumoAffHomog33Init(sumo, s, &A); }, affine, 4353);
    add(2, [&](SumoStateVector *s) { return bSumoAffHomog33InitTranslation(sumo, s, &A); }, affine, 4355);

    // Dehomogenised 2D point from the homogeneous readout.
    const Value dehom2 = [&](const SumoStateVector *s, Eigen::MatrixXd *J) {
        Plx_Vector3 h;
        EXPECT_TRUE(bSumoPoint2DHRead(s, &h));
        const double w = h.z, d[6] = {1 / w, 0, -h.x / (w * w), 0, 1 / w, -h.y / (w * w)};
        filled(J, [&](Plx_Matrix *o) { return bSumoPoint2DHFillJacobian2(o, d, 1.0, s->x.type); });
        return Eigen::Vector2d(h.x / w, h.y / w).eval();
    };
    const Plx_Vector2 e2 = {0.7, -1.3};
    add(2, [&](SumoStateVector *s) { return bSumoPoint2DInit(sumo, s, &e2); }, dehom2, 257);
    const Plx_Vector3 h2[4] = {{0.3, -0.5, 0.8}, {2.0, 0.5, 0.8}, {0.3, 2.0, 0.8}, {0.3, -0.5, 2.0}};
    add(3, [&](SumoStateVector *s) { return bSumoPoint2DHInit(sumo, s, &h2[0]); }, dehom2, 258);
    for (int k = 0; k < 3; ++k)
        add(2, [&](SumoStateVector *s) { return bSumoPoint2DHInitMimimal(sumo, s, &h2[k + 1]); }, dehom2, 260 + k);
    // A line evaluated at two points, scaled by 2 through the filler.
    const Value line = [&](const SumoStateVector *s, Eigen::MatrixXd *J) {
        Plx_Vector3 l;
        EXPECT_TRUE(bSumoLine2DHRead(s, &l));
        const double d[6] = {0.5, -1.0, 1.0, 2.0, 0.25, 1.0};
        filled(J, [&](Plx_Matrix *o) { return bSumoLine2DHFillJacobian2(o, d, 2.0, s->x.type); });
        return Eigen::Vector2d(2 * (0.5 * l.x - l.y + l.z), 2 * (2 * l.x + 0.25 * l.y + l.z)).eval();
    };
    const Plx_Vector3 l = {0.6, -0.8, 2.0};
    add(3, [&](SumoStateVector *s) { return bSumoLine2DHInit(sumo, s, &l); }, line, 513);
    const Value dehom3 = [&](const SumoStateVector *s, Eigen::MatrixXd *J) {
        Plx_Vector4 h;
        EXPECT_TRUE(bSumoPoint3DHRead(s, &h));
        const double w = h.w, w2 = w * w;
        const double d[12] = {1 / w, 0, 0, -h.x / w2, 0, 1 / w, 0, -h.y / w2, 0, 0, 1 / w, -h.z / w2};
        filled(J, [&](Plx_Matrix *o) { return bSumoPoint3DHFillJacobian3(o, d, 1.0, s->x.type); });
        return Eigen::Vector3d(h.x / w, h.y / w, h.z / w).eval();
    };
    const Plx_Vector3 e3 = {0.5, -1.5, 2.5};
    add(3, [&](SumoStateVector *s) { return bSumoPoint3DInit(sumo, s, &e3); }, dehom3, 769);
    const Plx_Vector4 h3[5] = {
        {0.2, 0.4, -0.6, 0.9}, {3, 0.4, -0.6, 0.9}, {0.2, 3, -0.6, 0.9}, {0.2, 0.4, 3, 0.9}, {0.2, 0.4, -0.6, 3}};
    add(4, [&](SumoStateVector *s) { return bSumoPoint3DHInit(sumo, s, &h3[0]); }, dehom3, 771);
    for (int k = 0; k < 4; ++k)
        add(3, [&](SumoStateVector *s) { return bSumoPoint3DHInitMimimal(sumo, s, &h3[k + 1]); }, dehom3, 773 + k);

    // A rotation's nine entries, at zero and away from it.
    const Value rotation = [&](const SumoStateVector *s, Eigen::MatrixXd *J) {
        Plx_Matrix33 R;
        EXPECT_TRUE(bSumoRotate3DRead(s, &R));
        filled(J, [&](Plx_Matrix *o) { return bSumoRotate3DJacobian(s, o); });
        Eigen::VectorXd v(9);
        for (int i = 0; i < 9; ++i) v[i] = R.m[i / 3][i % 3];
        return v;
    };
    Plx_Matrix33 R0;
    const Plx_Vector3 w0 = {0.3, -0.5, 0.2};
    ASSERT_TRUE(plx_rot3D_from_exponential_q(&w0, &R0));
    for (int away = 0; away < 2; ++away)
        add(3, [&](SumoStateVector *s) {
            const double x[3] = {0.4, 1.1, -0.7};
            const Plx_Bool ok = bSumoRotate3DInit(sumo, s, &R0);
            if (away) std::memcpy(s->x.v.data, x, sizeof x);
            return ok;
        }, rotation, 4609);

    // Every camera code's projection of a point.
    const Plx_Vector3 X = {0.3, -0.2, 2.0};
    const Value project = [&](const SumoStateVector *s, Eigen::MatrixXd *J) {
        Plx_Vector3 q;
        Plx_Matrix Js;
        plx_mat_form(&Js, 1, 1);
        EXPECT_TRUE(bSumoCameraProjectPoint(s, &X, &q, nullptr, J != nullptr ? &Js : nullptr));
        if (J != nullptr) *J = to_eigen(Js);
        plx_mat_free(&Js);
        return Eigen::Vector2d(q.x, q.y).eval();
    };
    Plx_Camera radial, xy;
    ASSERT_TRUE(plx_camera_build_radial_3(&radial, 1.0, 800, 780, 320, 240, -0.1, 0.02, -0.003));
    ASSERT_TRUE(plx_camera_build_xy_distortion(&xy, 1.0, 800, 780, 320, 240, 0.01, -0.02, 0.03, 0.005));
    std::vector<SumoStateVector *> cameras;
    for (int32_t code = 8195; code <= 8203; ++code) {
        cameras.push_back(pSumoCameraNew(sumo, sumo->root, code < 8202 ? &radial : &xy, code, 5, nullptr));
        ASSERT_NE(cameras.back(), nullptr);
        cases.emplace_back(cameras.back(), project);
    }

    for (auto &[s, g] : cases) expect_jacobian(s, g, std::to_string(s->x.type).c_str());

    // The cameras' Jacobians with respect to the point.
    for (SumoStateVector *c : cameras) {
        SCOPED_TRACE(c->x.type);
        Plx_Vector3 q;
        Plx_Matrix Jp;
        plx_mat_form(&Jp, 1, 1);
        ASSERT_TRUE(bSumoCameraProjectPoint(c, &X, &q, &Jp, nullptr));
        ASSERT_EQ(Jp.rows, 2u);
        ASSERT_EQ(Jp.cols, 3u);
        for (int k = 0; k < 3; ++k) {
            Plx_Vector3 a = X, b = X, pa, pb;
            (&a.x)[k] += 1e-6;
            (&b.x)[k] -= 1e-6;
            ASSERT_TRUE(bSumoCameraProjectPoint(c, &a, &pa, nullptr, nullptr));
            ASSERT_TRUE(bSumoCameraProjectPoint(c, &b, &pb, nullptr, nullptr));
            EXPECT_NEAR(Jp.data[k], (pa.x - pb.x) / 2e-6, 1e-4);
            EXPECT_NEAR(Jp.data[3 + k], (pa.y - pb.y) / 2e-6, 1e-4);
        }
        plx_mat_free(&Jp);
    }
}

// ---- homographies ----

TEST(SumoStatesHomog33, InitResetReadAndMinimalChoice)
{
    Model m;
    SumoStateVector *s = m.state(9);
    ASSERT_TRUE(bSumoHomog33Init(m.sumo.get(), s, &kH));
    EXPECT_EQ(s->x.type, SUMO_TYPE_HOMOG33);
    EXPECT_EQ(s->status, SUMO_STATE_ACTIVE);
    EXPECT_NEAR(params(s).norm(), 1.0, 1e-15);
    Plx_Matrix33 H;
    ASSERT_TRUE(bSumoHomog33Read(s, &H));
    EXPECT_TRUE(eig(H).isApprox(eig(kH) / eig(kH).norm(), 1e-15));
    // One scale observation, z = 1, information 1000, predicting the squared norm; a second
    // Init does not add another.
    ASSERT_EQ(uiSumoStateVectorObsListSize(s), 1u);
    const SumoObs *o = s->obs_active;
    EXPECT_EQ(o->func.h, bSumoHomog33ScaleH);
    EXPECT_EQ(o->z.v.data[0], 1.0);
    EXPECT_EQ(plx_squmat_get(&o->N, 0, 0), 1000.0);
    ASSERT_TRUE(bSumoHomog33Init(m.sumo.get(), s, &kH));
    EXPECT_EQ(uiSumoStateVectorObsListSize(s), 1u);
    // Types without a free scale drop it.
    ASSERT_TRUE(bSumoHomog33InitMinimal(m.sumo.get(), s, &kH));
    EXPECT_EQ(uiSumoStateVectorObsListSize(s), 0u);
    ASSERT_TRUE(bSumoHomog33Init(m.sumo.get(), s, &kH));
    ASSERT_TRUE(bSumoHomog33InitFixed(m.sumo.get(), s, &kH));
    EXPECT_EQ(uiSumoStateVectorObsListSize(s), 0u);

    struct Case {
        Plx_Matrix33 H;
        int32_t type;
    };
    const Case cases[] = {
        {mat33({1, 0, 0, 0, 1, 0, 0, 0, 1}), 4099},          // ties after the first pair keep entry 0
        {mat33({2, 2, 0, 0, 1, 0, 0, 0, 1}), 4100},          // entries 0 and 1 equal and largest: 1
        {mat33({0.5, 0.1, 3, 0.2, 0.4, 3, 0, 0, 1}), 4101},  // a later tie keeps the earlier entry
        {mat33({-1, 0, 0, 0, -1, 0, 0, 0, -1}), 4099},       // no positive entry: the most negative
        {kH, 4101},
    };
    for (const Case &c : cases) {
        SumoStateVector *t = m.state(9);
        ASSERT_TRUE(bSumoHomog33InitMinimal(m.sumo.get(), t, &c.H));
        EXPECT_EQ(t->x.type, c.type);
        EXPECT_EQ(t->x.v.rows, 8u);
        EXPECT_EQ(uiSumoStateVectorObsListSize(t), 0u);
        ASSERT_TRUE(bSumoHomog33Read(t, &H));
        const int k = c.type - 4099;
        EXPECT_TRUE(eig(H).isApprox(eig(c.H) / c.H.m[k / 3][k % 3], 1e-15));
    }

    // Reset keeps the code; a zero fixed entry is code 18 and leaves the parameters.
    SumoStateVector *t = m.state(8);
    ASSERT_TRUE(bSumoHomog33InitMinimal(m.sumo.get(), t, &kH));
    const Eigen::VectorXd before = params(t);
    Plx_Matrix33 Z = kH;
    Z.m[0][2] = 0.0;
    EXPECT_TRUE(fails_with(bSumoHomog33Reset(t, &Z), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(params(t), before);
    Plx_Matrix33 K = kH;
    K.m[0][0] = 7.0;
    ASSERT_TRUE(bSumoHomog33Reset(t, &K));
    EXPECT_EQ(t->x.type, 4101);
    ASSERT_TRUE(bSumoHomog33Read(t, &H));
    EXPECT_TRUE(eig(H).isApprox(eig(K) / 3.0, 1e-15));
    // A zero matrix has no scale: code 18, the state untouched.
    SumoStateVector *u = m.state(9);
    const Plx_Matrix33 zero = {};
    EXPECT_TRUE(fails_with(bSumoHomog33Init(m.sumo.get(), u, &zero), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(u->status, SUMO_STATE_UNINITIALISED);
    EXPECT_EQ(u->x.type, SUMO_UNSET_LABEL);

    // The float twins behave identically.
    Plx_Matrix33_f Hf;
    plx_mat33f_from_mat33(&kH, &Hf);
    SumoStateVector *f = m.state(9);
    ASSERT_TRUE(bSumoHomog33FInitMinimal(m.sumo.get(), f, &Hf));
    EXPECT_EQ(f->x.type, 4101);
    ASSERT_TRUE(bSumoHomog33FReset(f, &Hf));
    Plx_Matrix33_f Rf;
    ASSERT_TRUE(bSumoHomog33FRead(f, &Rf));
    for (int i = 0; i < 9; ++i) EXPECT_NEAR(Rf.m[i / 3][i % 3], kH.m[i / 3][i % 3] / 3.0, 1e-6);
    ASSERT_TRUE(bSumoHomog33FInit(m.sumo.get(), f, &Hf));
    EXPECT_EQ(f->x.type, SUMO_TYPE_HOMOG33);
    EXPECT_EQ(uiSumoStateVectorObsListSize(f), 1u);
}

// Transfer of a source point (kept in z's user data) through the homography.
Plx_Bool h_transfer(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *z, Plx_Vector *h,
                    Plx_Matrix **J)
{
    Plx_Matrix33 H;
    if (!bSumoHomog33Read(s[0], &H)) return PLX_FALSE;
    const double *p = static_cast<const double *>(z->user_data);
    const Eigen::Vector3d q = eig(H) * Eigen::Vector3d(p[0], p[1], 1.0);
    h->data[0] = q[0] / q[2];
    h->data[1] = q[1] / q[2];
    if (J != nullptr && J[0] != nullptr) {
        double d[18] = {};
        for (int i = 0; i < 3; ++i) {
            const double pi = i < 2 ? p[i] : 1.0;
            d[i] = pi / q[2];
            d[6 + i] = -q[0] / (q[2] * q[2]) * pi;
            d[12 + i] = pi / q[2];
            d[15 + i] = -q[1] / (q[2] * q[2]) * pi;
        }
        return bSumoHomog33FillJacobian2(J[0], d, 1.0, s[0]->x.type);
    }
    return PLX_TRUE;
}

struct Fit {
    Model m;
    SumoStateVector *H = nullptr;
    std::vector<std::array<double, 2>> src;
};

// Fits a homography state to the point pairs with Levenberg-Marquardt, by the type's analytic
// Jacobians or by central differences with the state's own step.
Eigen::Matrix3d solve_fit(Fit &f, bool minimal, bool numeric, const std::vector<Eigen::Vector2d> &a,
                          const std::vector<Eigen::Vector2d> &b, const Plx_Matrix33 &start)
{
    f.H = f.m.state(9);
    EXPECT_TRUE(minimal ? bSumoHomog33InitMinimal(f.m.sumo.get(), f.H, &start)
                        : bSumoHomog33Init(f.m.sumo.get(), f.H, &start));
    f.src.resize(a.size());
    for (size_t i = 0; i < a.size(); ++i) {
        f.src[i] = {a[i][0], a[i][1]};
        Vec z{b[i][0], b[i][1]};
        Squ N(2, 1.0);
        SumoObs *o = pSumoObsH(f.m.sumo.get(), &z.v, &N.m, h_transfer, nullptr, &f.H, 1);
        EXPECT_NE(o, nullptr);
        o->z.user_data = f.src[i].data();
        o->numeric_jacobians = numeric ? 1u : 0u;
    }
    f.H->jacobian_step = 1e-8;
    double lambda = 1e-3;
    for (int it = 0; it < 50; ++it) {
        uint32_t accepted = 0;
        double reduction = 0.0;
        EXPECT_TRUE(iterate(f.m.sumo.get(), lambda, &accepted, &reduction));
        lambda = accepted ? lambda * 0.1 : lambda * 10.0;
        if (accepted && reduction < 1e-20) break;
    }
    Plx_Matrix33 H;
    EXPECT_TRUE(bSumoHomog33Read(f.H, &H));
    return eig(H);
}

double transfer_error(const Eigen::Matrix3d &H, const std::vector<Eigen::Vector2d> &a,
                      const std::vector<Eigen::Vector2d> &b)
{
    double e = 0.0;
    for (size_t i = 0; i < a.size(); ++i) e += (((H * a[i].homogeneous()).hnormalized()) - b[i]).squaredNorm();
    return e;
}

TEST(SumoStatesHomog33, FitMatchesDirectLinearFit)
{
    const Eigen::Matrix3d truth = eig(mat33({1.1, 0.05, 0.2, -0.08, 0.95, -0.1, 0.15, -0.1, 1.0}));
    std::vector<Eigen::Vector2d> a, clean, noisy;
    const double noise[12][2] = {{1, -2}, {-3, 1}, {2, 2}, {0, -1}, {-1, 3}, {2, 0},
                                 {-2, -2}, {1, 1}, {3, -1}, {-1, 0}, {0, 2}, {1, -3}};
    for (int i = 0; i < 12; ++i) {
        a.emplace_back(-1.0 + 0.6 * (i % 4) + 0.05 * i, -0.9 + 0.8 * (i / 4) - 0.03 * i);
        clean.push_back((truth * a.back().homogeneous()).hnormalized());
        noisy.push_back(clean.back() + 1e-3 * Eigen::Vector2d(noise[i][0], noise[i][1]));
    }
    auto dlt = [&](const std::vector<Eigen::Vector2d> &b) {
        Plx_SquMatrix A;
        plx_squmat_form(&A, PLX_SQUMAT_SYMMETRIC, 9);
        plx_squmat_fill_zero(&A);
        for (size_t i = 0; i < a.size(); ++i) {
            const Plx_Vector3 x = {a[i][0], a[i][1], 1}, xp = {b[i][0], b[i][1], 1};
            EXPECT_TRUE(plx_homog33_increment_p(&A, &x, &xp));
        }
        Plx_Matrix33 H;
        EXPECT_TRUE(plx_homog33_solve(&A, uint32_t(2 * a.size()), &H));
        plx_squmat_free(&A);
        return eig(H);
    };
    const Plx_Matrix33 start = mat33({1, 0, 0, 0, 1, 0, 0, 0, 1});
    for (bool minimal : {false, true}) {
        SCOPED_TRACE(minimal ? "minimal" : "full");
        std::vector<Eigen::Matrix3d> noisy_fits;
        for (bool numeric : {false, true}) {
            SCOPED_TRACE(numeric ? "central differences" : "analytic");
            Fit exact, fit;
            const Eigen::Matrix3d He = solve_fit(exact, minimal, numeric, a, clean, start);
            const Eigen::Matrix3d D = dlt(clean);
            EXPECT_TRUE((He / He(2, 2)).isApprox(D / D(2, 2), 1e-8));
            EXPECT_TRUE((He / He(2, 2)).isApprox(truth, 1e-8));
            // Noisy pairs: the least-squares transfer fit stays near the linear fit, and its
            // transfer error (what it minimises) is no larger.
            const Eigen::Matrix3d Hn = solve_fit(fit, minimal, numeric, a, noisy, start);
            const Eigen::Matrix3d Dn = dlt(noisy);
            EXPECT_LT(((Hn / Hn(2, 2)) - (Dn / Dn(2, 2))).norm(), 5e-3);
            EXPECT_LE(transfer_error(Hn, a, noisy), transfer_error(Dn, a, noisy) * (1 + 1e-9));
            // The scale observation holds the free scale at unit norm.
            if (!minimal) {
                EXPECT_NEAR(params(fit.H).norm(), 1.0, 1e-9);
            }
            noisy_fits.push_back(Hn / Hn(2, 2));
        }
        // Differences and analytic Jacobians reach the same optimum.
        EXPECT_LT((noisy_fits[0] - noisy_fits[1]).norm(), 1e-7);
    }
}

// ---- affine motions ----

TEST(SumoStatesAffine, CodesReadAndResetAsDocumented)
{
    Model m;
    const Plx_Matrix23 A = {{{1.2, -0.3, 4.0}, {0.5, 0.8, -2.0}}};
    struct Case {
        Plx_Bool (*init)(Sumo *, SumoStateVector *, const Plx_Matrix23 *);
        int32_t type;
        std::vector<double> x;
        Plx_Matrix23 read;
    };
    const Case cases[] = {
        {bSumoAffHomog33Init, 4353, {1.2, -0.3, 4.0, 0.5, 0.8, -2.0}, A},
        {bSumoAffHomog33InitTranslation, 4355, {4.0, -2.0}, {{{1, 0, 4.0}, {0, 1, -2.0}}}},
        {bSumoAffHomog33InitTransScale, 4356, {1.0, 4.0, -2.0}, {{{1.0, 0, 4.0}, {0, 1.0, -2.0}}}},
        {bSumoAffHomog33InitTransRotScale, 4357, {1.0, 4.0, 0.4, -2.0}, {{{1.0, -0.4, 4.0}, {0.4, 1.0, -2.0}}}},
    };
    for (const Case &c : cases) {
        SumoStateVector *s = m.state(1);
        ASSERT_TRUE(c.init(m.sumo.get(), s, &A));
        EXPECT_EQ(s->x.type, c.type);
        ASSERT_EQ(s->x.v.rows, c.x.size());
        for (size_t i = 0; i < c.x.size(); ++i) EXPECT_NEAR(s->x.v.data[i], c.x[i], 1e-15);
        Plx_Matrix23 R;
        Plx_Matrix23_f Rf;
        ASSERT_TRUE(bSumoAffHomog33Read(s, &R));
        ASSERT_TRUE(bSumoAffHomog33FRead(s, &Rf));
        for (int r = 0; r < 2; ++r)
            for (int k = 0; k < 3; ++k) {
                EXPECT_NEAR(R.m[r][k], c.read.m[r][k], 1e-15);
                EXPECT_EQ(Rf.m[r][k], float(R.m[r][k]));
            }
        // Reset from what was read reproduces the parameters.
        const Eigen::VectorXd x = params(s);
        ASSERT_TRUE(bSumoAffHomog33Reset(s, &R));
        EXPECT_TRUE(params(s).isApprox(x, 1e-15));
        EXPECT_EQ(uiSumoStateVectorObsListSize(s), 0u);
    }
    // Scale and rotation parameters are not a column selection: the fillers refuse them.
    Plx_Matrix J;
    plx_mat_form(&J, 1, 1);
    const double d[12] = {};
    EXPECT_TRUE(fails_with(bSumoAffHomog33FillJacobian1(&J, d, 1.0, 4356), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoAffHomog33FillJacobian2(&J, d, 1.0, 4357), PLX_ERROR_ILLEGAL_TYPE));
    plx_mat_free(&J);
    // Float twins.
    const Plx_Matrix23_f Af = {{{1.5f, 0.25f, -1.0f}, {-0.25f, 1.5f, 2.0f}}};
    SumoStateVector *f = m.state(4);
    ASSERT_TRUE(bSumoAffHomog33FInitTransRotScale(m.sumo.get(), f, &Af));
    EXPECT_EQ(params(f), Eigen::Vector4d(1.5, -1.0, -0.25, 2.0));
    ASSERT_TRUE(bSumoAffHomog33FInitTransScale(m.sumo.get(), f, &Af));
    EXPECT_EQ(params(f), Eigen::Vector3d(1.5, -1.0, 2.0));
    ASSERT_TRUE(bSumoAffHomog33FInitTranslation(m.sumo.get(), f, &Af));
    ASSERT_TRUE(bSumoAffHomog33FInit(m.sumo.get(), f, &Af));
    ASSERT_TRUE(bSumoAffHomog33FReset(f, &Af));
    EXPECT_EQ(f->x.type, 4353);
    EXPECT_EQ(params(f)[1], 0.25);
}

// ---- fixed types ----

// Nine entries of the second state through the m x 9 filler; the first state's (fixed or
// not) columns through the same filler.
Plx_Bool h_pair(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *, Plx_Vector *h,
                Plx_Matrix **J)
{
    Plx_Matrix33 A, B;
    if (!bSumoHomog33Read(s[0], &A) || !bSumoHomog33Read(s[1], &B)) return PLX_FALSE;
    for (int i = 0; i < 9; ++i) h->data[i] = B.m[i / 3][i % 3] - A.m[i / 3][i % 3];
    Plx_Matrix d;
    plx_mat_form(&d, 9, 9);
    plx_mat_fill_zero(&d);
    for (int i = 0; i < 9; ++i) d.data[i * 9 + i] = 1.0;
    bool ok = true;
    for (int k = 0; k < 2 && J != nullptr; ++k)
        if (J[k] != nullptr) ok = ok && bSumoHomog33FillJacobian(J[k], &d, k == 0 ? -1.0 : 1.0, s[k]->x.type);
    plx_mat_free(&d);
    return ok ? PLX_TRUE : PLX_FALSE;
}

TEST(SumoStatesFixed, NoDimensionNoColumnsNoBlocksAndStoredObjects)
{
    Model m;
    SumoStateVector *fixed = m.state(9), *free_state = m.state(9);
    ASSERT_TRUE(bSumoHomog33InitFixed(m.sumo.get(), fixed, &kH));
    EXPECT_EQ(fixed->x.type, SUMO_TYPE_HOMOG33_FIXED);
    EXPECT_EQ(fixed->x.v.rows, 0u);
    EXPECT_EQ(fixed->A.size, 0u);
    EXPECT_EQ(uiSumoStateVectorObsListSize(fixed), 0u);
    ASSERT_TRUE(bSumoHomog33Init(m.sumo.get(), free_state, &kH));
    Plx_Matrix33 H;
    ASSERT_TRUE(bSumoHomog33Read(fixed, &H));
    EXPECT_EQ(eig(H), eig(kH));
    // The observation between them sees no columns of the fixed state and the model no block.
    Vec z{0, 0, 0, 0, 0, 0, 0, 0, 0};
    Squ N(9, 1.0);
    SumoStateVector *pair[2] = {fixed, free_state};
    ASSERT_NE(pSumoObsH(m.sumo.get(), &z.v, &N.m, h_pair, nullptr, pair, 2), nullptr);
    uint32_t first, last;
    ASSERT_TRUE(bSumoCreateOffdiagBlocksBranch(m.sumo.get(), m.sumo->root, &first, &last));
    EXPECT_EQ(fixed->row_blocks, nullptr);
    EXPECT_EQ(fixed->col_blocks, nullptr);
    EXPECT_EQ(free_state->row_blocks, nullptr);
    EXPECT_EQ(free_state->col_blocks, nullptr);
    for (int it = 0; it < 20; ++it)
        ASSERT_TRUE(iterate(m.sumo.get()));
    // Pulled onto the fixed matrix (scaled to unit norm by its own observation).
    ASSERT_TRUE(bSumoHomog33Read(free_state, &H));
    EXPECT_TRUE((eig(H) / H.m[2][2]).isApprox(eig(kH) / kH.m[2][2], 1e-6)) << eig(H) << "\n" << eig(kH);
    Plx_Matrix J;
    plx_mat_form(&J, 1, 1);
    const double d[18] = {};
    ASSERT_TRUE(bSumoHomog33FillJacobian1(&J, d, 1.0, SUMO_TYPE_HOMOG33_FIXED));
    EXPECT_EQ(J.rows, 1u);
    EXPECT_EQ(J.cols, 0u);
    ASSERT_TRUE(bSumoAffHomog33FillJacobian2(&J, d, 1.0, SUMO_TYPE_AFFHOMOG33_FIXED));
    EXPECT_EQ(J.rows, 2u);
    EXPECT_EQ(J.cols, 0u);
    ASSERT_TRUE(bSumoPoint3DFillJacobian1(&J, d, 1.0, SUMO_TYPE_POINT3D_FIXED));
    ASSERT_TRUE(bSumoPoint3DHFillJacobian2(&J, d, 1.0, SUMO_TYPE_POINT3DH_FIXED));
    ASSERT_TRUE(bSumoLine2DHFillJacobian1(&J, d, 1.0, SUMO_TYPE_LINE2DH_FIXED));
    EXPECT_EQ(J.cols, 0u);
    plx_mat_free(&J);

    // Without an object: identity motions, origin points; with one: the stored object, also in
    // a copy of the state.
    SumoStateVector *a = m.state(6), *h = m.state(9), *p = m.state(3), *r = m.state(3), *l = m.state(3);
    ASSERT_TRUE(bSumoAffHomog33InitFixed(m.sumo.get(), a, nullptr));
    ASSERT_TRUE(bSumoHomog33InitFixed(m.sumo.get(), h, nullptr));
    ASSERT_TRUE(bSumoPoint3DInitFixed(m.sumo.get(), p, nullptr));
    ASSERT_TRUE(bSumoRotate3DInitFixed(m.sumo.get(), r, nullptr));
    ASSERT_TRUE(bSumoLine2DHInitFixed(m.sumo.get(), l, nullptr));
    Plx_Matrix23 A;
    ASSERT_TRUE(bSumoAffHomog33Read(a, &A));
    const double identity[6] = {1, 0, 0, 0, 1, 0};
    EXPECT_EQ(std::memcmp(&A.m[0][0], identity, sizeof identity), 0);
    ASSERT_TRUE(bSumoHomog33Read(h, &H));
    EXPECT_EQ(eig(H), Eigen::Matrix3d::Identity());
    ASSERT_TRUE(bSumoRotate3DRead(r, &H));
    EXPECT_TRUE(eig(H).isApprox(Eigen::Matrix3d::Identity(), 1e-15));
    Plx_Vector4 q;
    ASSERT_TRUE(bSumoPoint3DHRead(p, &q));
    EXPECT_EQ(Eigen::Vector4d(q.x, q.y, q.z, q.w), Eigen::Vector4d(0, 0, 0, 1));
    Plx_Vector3 v;
    EXPECT_TRUE(fails_with(bSumoLine2DHRead(l, &v), PLX_ERROR_NOT_INITIALISED));
    const Plx_Matrix23 A1 = {{{2, 0, 1}, {0, 2, 3}}};
    ASSERT_TRUE(bSumoAffHomog33InitFixed(m.sumo.get(), a, &A1));
    SumoStateVector *copy = pSumoStateVectorCopy(a, m.sumo.get(), m.sumo->root, nullptr, nullptr);
    ASSERT_NE(copy, nullptr);
    EXPECT_NE(copy->x.user_data, a->x.user_data);
    ASSERT_TRUE(bSumoAffHomog33InitFixed(m.sumo.get(), a, nullptr));
    ASSERT_TRUE(bSumoAffHomog33Read(copy, &A));
    EXPECT_EQ(A.m[1][2], 3.0);
    EXPECT_EQ(A.m[0][0], 2.0);
}

// ---- points ----

TEST(SumoStatesPoints, HomogeneousMinimalAndEuclideanReadouts)
{
    Model m;
    struct Case {
        Plx_Vector3 p;
        int32_t type;
    };
    for (const Case &c : {Case{{2, 2, 1}, 261}, Case{{1, 1, 1}, 261}, Case{{3, 1, 1}, 260}, Case{{0, -1, -3}, 262},
                          Case{{0.5, 0.2, 4}, 262}}) {
        SumoStateVector *s = m.state(3);
        ASSERT_TRUE(bSumoPoint2DHInitMimimal(m.sumo.get(), s, &c.p));
        EXPECT_EQ(s->x.type, c.type);
        Plx_Vector3 r;
        ASSERT_TRUE(bSumoPoint2DHRead(s, &r));
        const double k = (&c.p.x)[c.type - 260];
        EXPECT_TRUE(Eigen::Vector3d(r.x, r.y, r.z).isApprox(Eigen::Vector3d(c.p.x, c.p.y, c.p.z) / k, 1e-15));
    }
    const Plx_Vector4 origin = {0, 0, 0, 1};
    SumoStateVector *s = m.state(3);
    ASSERT_TRUE(bSumoPoint3DHInitMimimal(m.sumo.get(), s, &origin));
    EXPECT_EQ(s->x.type, 776);
    EXPECT_EQ(params(s), Eigen::Vector3d::Zero());
    // Homogeneous points keep unit norm and read back dehomogenised as Euclidean points.
    const Plx_Vector3 h = {3, -6, 1.5};
    ASSERT_TRUE(bSumoPoint2DHInit(m.sumo.get(), s, &h));
    EXPECT_EQ(s->x.type, 258);
    EXPECT_NEAR(params(s).norm(), 1.0, 1e-15);
    EXPECT_EQ(uiSumoStateVectorObsListSize(s), 1u);
    EXPECT_EQ(s->obs_active->func.h, bPoint2DHScaleH);
    Plx_Vector2 e;
    ASSERT_TRUE(bSumoPoint2DRead(s, &e));
    EXPECT_NEAR(e.x, 2.0, 1e-15);
    EXPECT_NEAR(e.y, -4.0, 1e-15);
    const Plx_Vector2 e2 = {1, 1};
    ASSERT_TRUE(bSumoPoint2DReset(s, &e2));
    EXPECT_NEAR(params(s).norm(), 1.0, 1e-15);
    const Plx_Vector3 at_infinity = {1, 0, 0};
    ASSERT_TRUE(bSumoPoint2DHReset(s, &at_infinity));
    EXPECT_TRUE(fails_with(bSumoPoint2DRead(s, &e), PLX_ERROR_DIVISION_BY_ZERO));
    const Plx_Vector4 h3 = {2, 4, -6, 2};
    SumoStateVector *t = m.state(4);
    ASSERT_TRUE(bSumoPoint3DHInit(m.sumo.get(), t, &h3));
    EXPECT_EQ(t->obs_active->func.h, bPoint3DHScaleH);
    Plx_Vector3 p3;
    ASSERT_TRUE(bSumoPoint3DRead(t, &p3));
    EXPECT_TRUE(Eigen::Vector3d(p3.x, p3.y, p3.z).isApprox(Eigen::Vector3d(1, 2, -3), 1e-15));
    const Plx_Vector3 l = {0, 3, 4};
    ASSERT_TRUE(bSumoLine2DHInit(m.sumo.get(), t, &l));
    EXPECT_EQ(t->x.v.rows, 3u);
    EXPECT_EQ(params(t), Eigen::Vector3d(0, 0.6, 0.8));
    // The point's scale observation serves the line as well: still one.
    EXPECT_EQ(uiSumoStateVectorObsListSize(t), 1u);
}

// ---- rotations ----

// h = R u for a direction u kept in z's user data.
Plx_Bool h_rotate(Sumo *, SumoWorkspace *, SumoStateVector **s, uint32_t, const SumoVector *z, Plx_Vector *h,
                  Plx_Matrix **J)
{
    Plx_Matrix33 R;
    if (!bSumoRotate3DRead(s[0], &R)) return PLX_FALSE;
    const double *u = static_cast<const double *>(z->user_data);
    for (int r = 0; r < 3; ++r) h->data[r] = R.m[r][0] * u[0] + R.m[r][1] * u[1] + R.m[r][2] * u[2];
    if (J != nullptr && J[0] != nullptr) {
        Plx_Matrix dR;
        plx_mat_form(&dR, 9, 3);
        const bool ok = bSumoRotate3DJacobian(s[0], &dR) && plx_mat_resize(J[0], 3, 3);
        for (int r = 0; ok && r < 3; ++r)
            for (int k = 0; k < 3; ++k) {
                double v = 0.0;
                for (int c = 0; c < 3; ++c) v += dR.data[(3 * r + c) * 3 + k] * u[c];
                J[0]->data[3 * r + k] = v;
            }
        plx_mat_free(&dR);
        return ok ? PLX_TRUE : PLX_FALSE;
    }
    return PLX_TRUE;
}

TEST(SumoStatesRotation, AdjustFoldsTheIncrementAndSolves)
{
    Model m;
    Plx_Matrix33 truth, R;
    const Plx_Vector3 w = {0.6, -0.9, 1.2};
    ASSERT_TRUE(plx_rot3D_from_exponential_q(&w, &truth));
    SumoStateVector *s = m.state(3);
    const Plx_Matrix33 I = mat33({1, 0, 0, 0, 1, 0, 0, 0, 1});
    ASSERT_TRUE(bSumoRotate3DInit(m.sumo.get(), s, &I));
    EXPECT_EQ(s->x.type, SUMO_TYPE_ROTATE3D);
    EXPECT_EQ(s->adjust_func, bSumoRotate3DAdjust);

    // Folding: the rotation is unchanged, the increment is zero; mode 1 restores the reference.
    const double x[3] = {0.1, -0.2, 0.05};
    std::memcpy(s->x.v.data, x, sizeof x);
    Plx_Matrix33 before;
    ASSERT_TRUE(bSumoRotate3DRead(s, &before));
    ASSERT_TRUE(bSumoRotate3DAdjust(m.sumo.get(), 0, s));
    EXPECT_EQ(params(s), Eigen::Vector3d::Zero());
    ASSERT_TRUE(bSumoRotate3DRead(s, &R));
    EXPECT_TRUE(eig(R).isApprox(eig(before), 1e-14));
    ASSERT_TRUE(bSumoRotate3DAdjust(m.sumo.get(), 1, s));
    ASSERT_TRUE(bSumoRotate3DRead(s, &R));
    EXPECT_TRUE(eig(R).isApprox(Eigen::Matrix3d::Identity(), 1e-14));

    // Three directions and their images under the truth.
    double u[3][3] = {{1, 0, 0}, {0, 1, 0}, {0.6, 0.0, 0.8}};
    for (auto &d : u) {
        const Eigen::Vector3d v = eig(truth) * Eigen::Vector3d(d[0], d[1], d[2]);
        Vec z{v[0], v[1], v[2]};
        Squ N(3, 1.0);
        SumoObs *o = pSumoObsH(m.sumo.get(), &z.v, &N.m, h_rotate, nullptr, &s, 1);
        ASSERT_NE(o, nullptr);
        o->z.user_data = d;
    }
    for (int it = 0; it < 12; ++it) {
        ASSERT_TRUE(iterate(m.sumo.get()));
        EXPECT_EQ(params(s), Eigen::Vector3d::Zero());
    }
    ASSERT_TRUE(bSumoRotate3DRead(s, &R));
    EXPECT_TRUE(eig(R).isApprox(eig(truth), 1e-12));
    // A new reference through Reset, and a fixed rotation keeps its matrix.
    ASSERT_TRUE(bSumoRotate3DReset(s, &I));
    ASSERT_TRUE(bSumoRotate3DRead(s, &R));
    EXPECT_TRUE(eig(R).isApprox(Eigen::Matrix3d::Identity(), 1e-15));
    SumoStateVector *f = m.state(3);
    ASSERT_TRUE(bSumoRotate3DInitFixed(m.sumo.get(), f, &truth));
    EXPECT_EQ(f->x.v.rows, 0u);
    ASSERT_TRUE(bSumoRotate3DRead(f, &R));
    EXPECT_TRUE(eig(R).isApprox(eig(truth), 1e-14));
    // Not a rotation: refused by the quaternion conversion (code 32 at the origin).
    const Plx_Matrix33 skewed = mat33({1, 0.5, 0, 0, 1, 0, 0, 0, 1});
    EXPECT_TRUE(fails_with(bSumoRotate3DInit(m.sumo.get(), f, &skewed), PLX_ERROR_ILLEGAL_ARGUMENT));
}

// ---- cameras ----

TEST(SumoStatesCamera, ResetReadRoundTripsAndRefusesWrongModels)
{
    Model m;
    Plx_Camera radial, xy, linear, inverse;
    ASSERT_TRUE(plx_camera_build_radial_3(&radial, 2.0, 800, 780, 320, 240, -0.1, 0.02, -0.003));
    ASSERT_TRUE(plx_camera_build_xy_distortion(&xy, 2.0, 800, 780, 320, 240, 0.01, -0.02, 0.03, 0.005));
    ASSERT_TRUE(plx_camera_build_linear(&linear, 2.0, 800, 780, 320, 240));
    ASSERT_TRUE(plx_camera_build_inv_radial(&inverse, 2.0, 800, 780, 320, 240, 0.1));
    struct Case {
        int32_t code;
        const Plx_Camera *camera;
        std::vector<double> x;
        int32_t model;
    };
    const Case cases[] = {
        {8194, &inverse, {}, PLX_INV_RADIAL_CAMERA},
        {8195, &radial, {-0.1}, PLX_RADIAL_CAMERA_1},
        {8196, &radial, {-0.1, 0.02}, PLX_RADIAL_CAMERA_2},
        {8197, &radial, {-0.1, 0.02, -0.003}, PLX_RADIAL_CAMERA_3},
        {8198, &radial, {320, 240, -0.1}, PLX_RADIAL_CAMERA_1},
        {8199, &radial, {320, 240, -0.1, 0.02}, PLX_RADIAL_CAMERA_2},
        {8200, &radial, {780, -0.1, 0.02}, PLX_RADIAL_CAMERA_2},
        {8201, &radial, {800, 780, 320, 240, -0.1, 0.02}, PLX_RADIAL_CAMERA_2},
        {8202, &xy, {0.01, -0.02, 0.03, 0.005}, PLX_XY_DISTORTION_CAMERA},
        {8203, &xy, {320, 240, 0.01, -0.02, 0.03, 0.005}, PLX_XY_DISTORTION_CAMERA},
        {8197, &linear, {0, 0, 0}, PLX_RADIAL_CAMERA_3},
        {8203, &linear, {320, 240, 0, 0, 0, 0}, PLX_XY_DISTORTION_CAMERA},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.code);
        SumoStateVector *s = pSumoCameraNew(m.sumo.get(), m.sumo->root, c.camera, c.code, 42, nullptr);
        ASSERT_NE(s, nullptr);
        EXPECT_EQ(s->x.type, c.code);
        EXPECT_EQ(s->x.label, 42);
        EXPECT_EQ(s->io_tag, uint32_t(SUMO_IO_TAG_CAMERA));
        EXPECT_EQ(s->status, SUMO_STATE_ACTIVE);
        ASSERT_EQ(s->x.v.rows, c.x.size());
        for (size_t i = 0; i < c.x.size(); ++i) EXPECT_EQ(s->x.v.data[i], c.x[i]);
        Plx_Camera r;
        ASSERT_TRUE(bSumoCameraRead(s, &r));
        EXPECT_EQ(r.type, c.model);
        EXPECT_EQ(r.zh, 2.0);
        EXPECT_EQ(r.fx, 800);
        EXPECT_EQ(r.y0, 240);
        // Estimated values come from the parameters.
        if (!c.x.empty()) {
            s->x.v.data[c.x.size() - 1] += 0.5;
            ASSERT_TRUE(bSumoCameraRead(s, &r));
            const double last = c.model == PLX_RADIAL_CAMERA_1 ? r.k[0]
                                : c.model == PLX_RADIAL_CAMERA_2 ? r.k[1]
                                : c.model == PLX_RADIAL_CAMERA_3 ? r.k[2]
                                                                 : r.k[3];
            EXPECT_EQ(last, c.x.back() + 0.5);
            // Reset brings the camera's own values back.
            ASSERT_TRUE(bSumoCameraReset(m.sumo.get(), m.ws.get(), s, c.camera, c.code));
            EXPECT_EQ(s->x.v.data[c.x.size() - 1], c.x.back());
        }
        // Projection agrees with the camera rebuilt by Read.
        const Plx_Vector3 X = {0.2, 0.1, 1.5};
        Plx_Vector3 a, b;
        ASSERT_TRUE(bSumoCameraRead(s, &r));
        ASSERT_TRUE(bSumoCameraProjectPoint(s, &X, &a, nullptr, nullptr));
        ASSERT_TRUE(plx_camera_project_point(&r, &X, &b));
        EXPECT_EQ(Eigen::Vector3d(a.x, a.y, a.z), Eigen::Vector3d(b.x, b.y, b.z));
    }
    // Models outside a code's set, and codes outside the range, are code 12; nothing is left.
    SumoBranch *b = pSumoBranchNewFromBranch(m.sumo.get(), m.sumo->root);
    const std::pair<int32_t, const Plx_Camera *> refused[] = {
        {8195, &inverse}, {8201, &xy}, {8202, &radial}, {8203, &inverse}, {8193, &linear}, {8204, &linear}};
    for (const auto &[code, camera] : refused) {
        EXPECT_TRUE(fails_with(pSumoCameraNew(m.sumo.get(), b, camera, code, 1, nullptr), PLX_ERROR_ILLEGAL_TYPE));
        EXPECT_EQ(b->first, nullptr);
    }
    SumoStateVector *s = m.state(2);
    EXPECT_TRUE(fails_with(bSumoCameraReset(m.sumo.get(), m.ws.get(), s, &inverse, 8196), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_EQ(s->status, SUMO_STATE_UNINITIALISED);
    EXPECT_EQ(s->x.v.rows, 2u);
}

// ---- failures ----

TEST(SumoStatesFailures, TypeCodesNullsAndStateConditions)
{
    Model m;
    Plx_Matrix33 H;
    Plx_Matrix23 A;
    Plx_Vector3 v;
    Plx_Camera c;
    SumoStateVector *h = m.state(9), *a = m.state(6), *l = m.state(3);
    ASSERT_TRUE(bSumoHomog33Init(m.sumo.get(), h, &kH));
    const Plx_Matrix23 A0 = {{{1, 0, 0}, {0, 1, 0}}};
    ASSERT_TRUE(bSumoAffHomog33Init(m.sumo.get(), a, &A0));
    const Plx_Vector3 l0 = {1, 2, 3};
    ASSERT_TRUE(bSumoLine2DHInit(m.sumo.get(), l, &l0));
    const Eigen::VectorXd hx = params(h);
    // A code of another type: 12, nothing written.
    EXPECT_TRUE(fails_with(bSumoHomog33Read(a, &H), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoHomog33Reset(a, &kH), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoAffHomog33Reset(h, &A), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoAffHomog33Read(h, &A), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoPoint2DHRead(l, &v), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoLine2DHRead(h, &v), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoPoint3DRead(h, &v), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoRotate3DRead(h, &H), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoCameraRead(h, &c), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_EQ(params(h), hx);
    Plx_Matrix J;
    plx_mat_form(&J, 1, 1);
    const double d[18] = {};
    EXPECT_TRUE(fails_with(bSumoHomog33FillJacobian1(&J, d, 1.0, 4353), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoHomog33FillJacobian2(&J, d, 1.0, 4108), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoPoint2DFillJacobian1(&J, d, 1.0, 258), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoPoint3DHFillJacobian1(&J, d, 1.0, 777), PLX_ERROR_ILLEGAL_TYPE));
    EXPECT_TRUE(fails_with(bSumoLine2DHFillJacobian2(&J, d, 1.0, 512), PLX_ERROR_ILLEGAL_TYPE));
    // Nulls: 32.
    EXPECT_TRUE(fails_with(bSumoHomog33FillJacobian1(nullptr, d, 1.0, 4097), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoHomog33FillJacobian(&J, nullptr, 1.0, 4097), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoHomog33Init(nullptr, h, &kH), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoHomog33Init(m.sumo.get(), h, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoHomog33Read(nullptr, &H), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoAffHomog33Read(a, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoCameraReset(m.sumo.get(), nullptr, l, nullptr, 8194), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoCameraProjectPoint(l, nullptr, &v, nullptr, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoRotate3DAdjust(m.sumo.get(), 0, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_TRUE(fails_with(bSumoHomog33ScaleH(m.sumo.get(), nullptr, nullptr, 0, nullptr, nullptr, nullptr),
                           PLX_ERROR_ILLEGAL_ARGUMENT));
    // An m x 9 filler with the wrong width: 7.
    Plx_Matrix wide;
    plx_mat_form(&wide, 2, 6);
    EXPECT_TRUE(fails_with(bSumoHomog33FillJacobian(&J, &wide, 1.0, 4097), PLX_ERROR_INCOMPATIBLE));
    plx_mat_free(&wide);
    plx_mat_free(&J);
    // The adjust function on a state that is not a rotation: 31.
    EXPECT_TRUE(fails_with(bSumoRotate3DAdjust(m.sumo.get(), 0, h), PLX_ERROR_NOT_INITIALISED));

    // An eliminated state cannot be re-initialised: 7.
    SumoStateVector *e = m.state(2);
    const Plx_Vector2 p = {1, 2};
    ASSERT_TRUE(bSumoPoint2DInit(m.sumo.get(), e, &p));
    Vec ez{1, 2};
    Squ eN(2, 1.0);
    ASSERT_NE(pSumoObsH(m.sumo.get(), &ez.v, &eN.m, h_identity, nullptr, &e, 1), nullptr);
    ASSERT_TRUE(bSumoStateEliminate(m.sumo.get(), m.ws.get(), e, SUMO_ADJUST_NONE, nullptr));
    EXPECT_TRUE(fails_with(bSumoPoint2DInit(m.sumo.get(), e, &p), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(bSumoHomog33InitFixed(m.sumo.get(), e, &kH), PLX_ERROR_INCOMPATIBLE));

    // Dimensions: heap states grow, memory-stack states only shrink.
    SumoStateVector *g = m.state(1);
    ASSERT_TRUE(bSumoHomog33Init(m.sumo.get(), g, &kH));
    EXPECT_EQ(g->x.v.rows, 9u);
    EXPECT_EQ(g->A.size, 9u);
    EXPECT_EQ(g->b_work.rows, 9u);
    Plx_MemoryStack ms;
    ASSERT_NE(plx_memory_stack_form(&ms, 0, 4096), nullptr);
    {
        SumoPtr sumo(pSumoForm(nullptr, nullptr));
        SumoStateVector *small = pSumoStateVectorNew(sumo.get(), sumo->root, 2, &ms, nullptr);
        ASSERT_NE(small, nullptr);
        EXPECT_TRUE(fails_with(bSumoHomog33Init(sumo.get(), small, &kH), PLX_ERROR_INCOMPATIBLE));
        EXPECT_EQ(small->x.v.rows, 2u);
        EXPECT_EQ(small->status, SUMO_STATE_UNINITIALISED);
        const Plx_Vector3 q = {1, 2, 3};
        ASSERT_TRUE(bSumoPoint3DInitFixed(sumo.get(), small, &q));
        EXPECT_EQ(small->x.v.rows, 0u);
        ASSERT_TRUE(bSumoPoint2DInit(sumo.get(), small, &p));
        EXPECT_EQ(small->x.v.rows, 2u);
    }
    plx_memory_stack_free(&ms);
}

}  // namespace
