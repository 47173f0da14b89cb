// Fixed-size matrices and vectors in both precisions, checked against Eigen computed in the
// test; and the quadratic solver.
#include <gtest/gtest.h>

#include <Eigen/Dense>
#include <cmath>
#include <cstring>
#include <random>

#include "failure_check.hpp"
#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

// The exported family of one size and precision.
#define FIXED_TRAITS(NAME, N_, T_, MAT, VEC, P, S, INV)                                         \
    struct NAME {                                                                             \
        static constexpr int N = N_;                                                          \
        using T = T_;                                                                         \
        using M = MAT;                                                                        \
        using V = VEC;                                                                        \
        static constexpr double tol = sizeof(T_) == 4 ? 2e-5 : 1e-12;                         \
        static void ident(M *a) { plx_##P##_ident_s(a); }                                     \
        static void transpose(const M *a, M *b) { plx_##P##_transpose_s(a, b); }             \
        static T det(const M *a) { return plx_##P##_det_s(a); }                               \
        static T fnorm(const M *a) { return plx_##P##_Fnorm_s(a); }                           \
        static void mult(const M *a, const M *b, M *c) { plx_##P##_rmultm##N_##N_##_s(a, b, c); } \
        static void multv(const M *a, const V *x, V *y) { plx_##P##_multv##N_##_s(a, x, y); } \
        static void tmultv(const M *a, const V *x, V *y) { plx_##P##_tmultv##N_##_s(a, x, y); } \
        static void add(const M *a, const M *b, M *c) { plx_##P##_add_s(a, b, c); }           \
        static void sub(const M *a, const M *b, M *c) { plx_##P##_sub_s(a, b, c); }           \
        static void scale(const M *a, T s, M *c) { plx_##P##_scale_s(a, s, c); }             \
        static Plx_Bool invert(const M *a, M *b) { return INV(a, b); }                        \
        static Plx_Bool chol(const M *a, M *l) { return plx_##S##_cholesky(a, l); }          \
        static Plx_Bool eig(const M *a, V *v, M *e) { return plx_##S##_eigen(a, v, e); }      \
    }

FIXED_TRAITS(D2, 2, double, Plx_Matrix22, Plx_Vector2, mat22, symmat22, plx_mat22_invert_s);
FIXED_TRAITS(F2, 2, float, Plx_Matrix22_f, Plx_Vector2_f, mat22f, symmat22f, plx_mat22f_invert_s);
FIXED_TRAITS(D3, 3, double, Plx_Matrix33, Plx_Vector3, mat33, symmat33, plx_mat33_invert_s);
FIXED_TRAITS(F3, 3, float, Plx_Matrix33_f, Plx_Vector3_f, mat33f, symmat33f, plx_mat33f_invert);
FIXED_TRAITS(D4, 4, double, Plx_Matrix44, Plx_Vector4, mat44, symmat44, plx_mat44_invert_s);
FIXED_TRAITS(F4, 4, float, Plx_Matrix44_f, Plx_Vector4_f, mat44f, symmat44f, plx_mat44f_invert_s);

template <class F>
using EMat = Eigen::Matrix<double, F::N, F::N>;
template <class F>
using EVec = Eigen::Matrix<double, F::N, 1>;

template <class F>
EMat<F> to_eigen(const typename F::M &a)
{
    EMat<F> e;
    for (int r = 0; r < F::N; ++r)
        for (int c = 0; c < F::N; ++c) e(r, c) = a.m[r][c];
    return e;
}

template <class F>
typename F::M from_eigen(const EMat<F> &e)
{
    typename F::M a;
    for (int r = 0; r < F::N; ++r)
        for (int c = 0; c < F::N; ++c) a.m[r][c] = typename F::T(e(r, c));
    return a;
}

template <class F>
EVec<F> to_eigen(const typename F::V &v)
{
    typename F::T p[F::N];
    static_assert(sizeof v == sizeof p);  // a record of N scalars
    std::memcpy(p, &v, sizeof p);
    EVec<F> e;
    for (int i = 0; i < F::N; ++i) e(i) = p[i];
    return e;
}

template <class F>
typename F::V from_eigen(const EVec<F> &e)
{
    typename F::T p[F::N];
    for (int i = 0; i < F::N; ++i) p[i] = typename F::T(e(i));
    typename F::V v;
    std::memcpy(&v, p, sizeof v);
    return v;
}

template <class F>
class Fixed : public ::testing::Test {
protected:
    std::mt19937 rng{1234};
    // Well conditioned: twice the identity plus a perturbation of norm below 1, drawn in T so
    // the values are exact in both precisions. (Rounding through from_eigen would do too,
    // but GCC 12's SLP vectoriser at -O3 drops a double -> float -> double round trip.)
    EMat<F> random_matrix()
    {
        using T = typename F::T;
        std::uniform_real_distribution<T> u(T(-0.25), T(0.25));
        typename F::M m;
        for (int r = 0; r < F::N; ++r)
            for (int c = 0; c < F::N; ++c) m.m[r][c] = (r == c ? T(2) : T(0)) + u(rng);
        return to_eigen<F>(m);
    }
    EMat<F> random_spd()
    {
        EMat<F> b = random_matrix();
        return b * b.transpose();
    }
};

using Families = ::testing::Types<D2, F2, D3, F3, D4, F4>;
TYPED_TEST_SUITE(Fixed, Families);

TYPED_TEST(Fixed, ProductsAndElementwiseMatchEigenAndAllowAliasing)
{
    using F = TypeParam;
    for (int trial = 0; trial < 20; ++trial) {
        EMat<F> a = this->random_matrix(), b = this->random_matrix();
        typename F::M A = from_eigen<F>(a), B = from_eigen<F>(b), C;
        F::mult(&A, &B, &C);
        EXPECT_LT((to_eigen<F>(C) - a * b).cwiseAbs().maxCoeff(), 4 * F::tol);
        F::mult(&A, &B, &A);  // output is the left input
        EXPECT_LT((to_eigen<F>(A) - a * b).cwiseAbs().maxCoeff(), 4 * F::tol);
        A = from_eigen<F>(a);
        F::transpose(&A, &A);
        EXPECT_EQ(to_eigen<F>(A), a.transpose());
        A = from_eigen<F>(a);
        EVec<F> x = EVec<F>::LinSpaced(F::N, -1.0, 2.0);
        typename F::V X = from_eigen<F>(x), Y;
        F::multv(&A, &X, &Y);
        EXPECT_LT((to_eigen<F>(Y) - a * x).cwiseAbs().maxCoeff(), 4 * F::tol);
        F::tmultv(&A, &X, &X);
        EXPECT_LT((to_eigen<F>(X) - a.transpose() * x).cwiseAbs().maxCoeff(), 4 * F::tol);
        F::add(&A, &B, &C);
        EXPECT_LT((to_eigen<F>(C) - (a + b)).cwiseAbs().maxCoeff(), F::tol);
        F::sub(&A, &B, &C);
        EXPECT_LT((to_eigen<F>(C) - (a - b)).cwiseAbs().maxCoeff(), F::tol);
        F::scale(&A, typename F::T(-0.5), &C);
        EXPECT_EQ(to_eigen<F>(C), -0.5 * a);
        EXPECT_NEAR(F::det(&A), a.determinant(), 4 * F::tol * std::fabs(a.determinant()));
        EXPECT_NEAR(F::fnorm(&A), a.norm(), F::tol * a.norm());
    }
    typename F::M I;
    F::ident(&I);
    EXPECT_EQ(to_eigen<F>(I), EMat<F>::Identity());
}

TYPED_TEST(Fixed, InverseTimesMatrixIsIdentityAndSingularFails)
{
    using F = TypeParam;
    // A singular matrix fails and leaves the output as it was.
    EMat<F> singular = this->random_matrix();
    singular.row(F::N - 1) = 2.0 * singular.row(0);  // exactly dependent rows (powers of two keep it exact)
    typename F::M S = from_eigen<F>(singular), out;
    F::ident(&out);
    EXPECT_TRUE(fails_with(F::invert(&S, &out), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(to_eigen<F>(out), EMat<F>::Identity());
    EXPECT_TRUE(fails_with(F::invert(nullptr, &out), PLX_ERROR_ILLEGAL_ARGUMENT));

    for (int trial = 0; trial < 50; ++trial) {
        EMat<F> a = this->random_matrix();
        typename F::M A = from_eigen<F>(a), Ai;
        ASSERT_TRUE(F::invert(&A, &Ai));
        EXPECT_LT((a * to_eigen<F>(Ai) - EMat<F>::Identity()).cwiseAbs().maxCoeff(), 8 * F::tol);
        ASSERT_TRUE(F::invert(&A, &A));  // in place
        EXPECT_EQ(to_eigen<F>(A), to_eigen<F>(Ai));
    }
    // A permutation needs pivoting: its leading element is zero.
    EMat<F> p = EMat<F>::Zero();
    for (int i = 0; i < F::N; ++i) p(i, (i + 1) % F::N) = 1;
    typename F::M P = from_eigen<F>(p), Pi;
    ASSERT_TRUE(F::invert(&P, &Pi));
    EXPECT_EQ(to_eigen<F>(Pi), p.transpose());
}

TYPED_TEST(Fixed, CholeskyReproducesTheMatrixAndRejectsIndefinite)
{
    using F = TypeParam;
    for (int trial = 0; trial < 20; ++trial) {
        EMat<F> a = this->random_spd();
        typename F::M A = from_eigen<F>(a), L;
        ASSERT_TRUE(F::chol(&A, &L));
        EMat<F> l = to_eigen<F>(L);
        EXPECT_EQ(l, EMat<F>(l.template triangularView<Eigen::Lower>()));
        EXPECT_LT((l * l.transpose() - a).cwiseAbs().maxCoeff(), 8 * F::tol * a.norm());
        EXPECT_GT(l.diagonal().minCoeff(), 0.0);
    }
    // Only the lower triangle is read.
    EMat<F> a = this->random_spd(), junk = a;
    junk.template triangularView<Eigen::StrictlyUpper>().setConstant(99.0);
    typename F::M A = from_eigen<F>(a), J = from_eigen<F>(junk), L1, L2;
    ASSERT_TRUE(F::chol(&A, &L1));
    ASSERT_TRUE(F::chol(&J, &L2));
    EXPECT_EQ(to_eigen<F>(L1), to_eigen<F>(L2));

    EMat<F> indefinite = EMat<F>::Identity();
    indefinite(F::N - 1, F::N - 1) = -1;
    typename F::M B = from_eigen<F>(indefinite), out = A;
    EXPECT_TRUE(fails_with(F::chol(&B, &out), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_EQ(to_eigen<F>(out), to_eigen<F>(A));
}

TYPED_TEST(Fixed, EigenPairsAreSortedUnitAndSatisfyAvEqualsLv)
{
    using F = TypeParam;
    for (int trial = 0; trial < 20; ++trial) {
        EMat<F> a = this->random_spd() - 2.0 * EMat<F>::Identity();  // mixed signs
        typename F::M A = from_eigen<F>(a), V;
        typename F::V vals;
        ASSERT_TRUE(F::eig(&A, &vals, &V));
        EVec<F> l = to_eigen<F>(vals);
        EMat<F> v = to_eigen<F>(V);
        Eigen::SelfAdjointEigenSolver<EMat<F>> ref(a);
        for (int i = 0; i < F::N; ++i) {
            if (i > 0) {
                EXPECT_LE(l(i - 1), l(i));
            }
            EXPECT_NEAR(l(i), ref.eigenvalues()(i), 8 * F::tol * a.norm());
            EXPECT_NEAR(v.col(i).norm(), 1.0, 4 * F::tol);
            EXPECT_LT((a * v.col(i) - l(i) * v.col(i)).norm(), 16 * F::tol * a.norm());
            Eigen::Index big;
            v.col(i).cwiseAbs().maxCoeff(&big);
            EXPECT_GT(v(big, i), 0.0);
        }
    }
}

TEST(FixedKnown, HandWorkedValues)
{
    // det [[1 2 3] [0 1 4] [5 6 0]] = 1, inverse [[-24 18 5] [20 -15 -4] [-5 4 1]].
    Plx_Matrix33 A = {{{1, 2, 3}, {0, 1, 4}, {5, 6, 0}}}, Ai;
    EXPECT_DOUBLE_EQ(plx_mat33_det_s(&A), 1.0);
    ASSERT_TRUE(plx_mat33_invert_s(&A, &Ai));
    const double expect[3][3] = {{-24, 18, 5}, {20, -15, -4}, {-5, 4, 1}};
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(Ai.m[r][c], expect[r][c], 1e-12);
    // [[4 2] [2 3]]: eigenvalues (7 -+ sqrt 17) / 2; Cholesky [[2 0] [1 sqrt 2]].
    Plx_Matrix22 S = {{{4, 2}, {2, 3}}}, L, V;
    Plx_Vector2 l;
    ASSERT_TRUE(plx_symmat22_cholesky(&S, &L));
    EXPECT_DOUBLE_EQ(L.m[0][0], 2.0);
    EXPECT_DOUBLE_EQ(L.m[1][0], 1.0);
    EXPECT_DOUBLE_EQ(L.m[1][1], std::sqrt(2.0));
    EXPECT_EQ(L.m[0][1], 0.0);
    ASSERT_TRUE(plx_symmat22_eigen(&S, &l, &V));
    EXPECT_NEAR(l.x, (7 - std::sqrt(17.0)) / 2, 1e-14);
    EXPECT_NEAR(l.y, (7 + std::sqrt(17.0)) / 2, 1e-14);
    // det of a 4x4 by hand: block triangular, det = det[[2 1][1 1]] * det[[3 0][1 2]] = 1 * 6.
    Plx_Matrix44 B = {{{2, 1, 7, -3}, {1, 1, 5, 2}, {0, 0, 3, 0}, {0, 0, 1, 2}}};
    EXPECT_DOUBLE_EQ(plx_mat44_det_s(&B), 6.0);
    // Conversions round trip exactly for values representable in float.
    Plx_Matrix33_f Af;
    Plx_Matrix33 back;
    plx_mat33f_from_mat33(&A, &Af);
    plx_mat33_from_mat33f(&Af, &back);
    EXPECT_EQ(0, std::memcmp(&A, &back, sizeof A));
    EXPECT_TRUE(std::isnan(plx_mat33_det_s(nullptr)));
}

TEST(FixedKnown, AffineMapsInvertAndCompose)
{
    const Plx_Matrix23 A = {{{0.8, -0.6, 10}, {0.5, 1.2, -3}}};
    Plx_Matrix23 Ai, AAi;
    ASSERT_TRUE(plx_mat23h_invert_q(&A, &Ai));
    plx_mat23h_rmultm23h_s(&A, &Ai, &AAi);
    const double id[2][3] = {{1, 0, 0}, {0, 1, 0}};
    for (int r = 0; r < 2; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(AAi.m[r][c], id[r][c], 1e-12);
    Plx_Vector2 p = {3, 4}, q, back;
    plx_mat23h_multv2_s(&A, &p, &q);
    EXPECT_DOUBLE_EQ(q.x, 0.8 * 3 - 0.6 * 4 + 10);
    plx_mat23h_multv2_s(&Ai, &q, &back);
    EXPECT_NEAR(back.x, 3, 1e-12);
    EXPECT_NEAR(back.y, 4, 1e-12);

    Plx_Matrix23_f Af, Afi;
    plx_mat23f_from_mat23(&A, &Af);
    ASSERT_TRUE(plx_mat23hf_invert_q(&Af, &Afi));
    EXPECT_NEAR(Afi.m[0][2], Ai.m[0][2], 1e-5);
    Plx_Matrix23_f singular = {{{1, 2, 5}, {2, 4, 1}}}, keep = Afi;
    EXPECT_TRUE(fails_with(plx_mat23hf_invert_q(&singular, &Afi), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(0, std::memcmp(&keep, &Afi, sizeof keep));
}

TEST(FixedKnown, VectorOperations)
{
    Plx_Vector3 a = {1, 2, 3}, b = {-2, 0.5, 4}, c;
    plx_vec3_cross_s(&a, &b, &c);
    EXPECT_DOUBLE_EQ(c.x, 2 * 4 - 3 * 0.5);
    EXPECT_DOUBLE_EQ(c.y, 3 * -2 - 1 * 4);
    EXPECT_DOUBLE_EQ(c.z, 1 * 0.5 - 2 * -2);
    EXPECT_NEAR(plx_vec3_dot_s(&c, &a), 0, 1e-14);
    plx_vec3_cross_s(&a, &b, &a);  // aliasing the output with an input
    EXPECT_EQ(0, std::memcmp(&a, &c, sizeof a));
    Plx_Vector4_f v = {3, 4, 12, 84};
    EXPECT_FLOAT_EQ(plx_vec4f_norm_s(&v), 85.0f);
    Plx_Vector2 p = {1, 2}, q = {3, 5}, r;
    plx_vec2_sub_s(&q, &p, &r);
    plx_vec2_scale_s(&r, 2, &r);
    EXPECT_EQ(r.x, 4);
    EXPECT_EQ(r.y, 6);
}

TEST(Quadratic, StableRootsAndDegenerateCases)
{
    double r1 = 0, r2 = 0;
    EXPECT_EQ(plx_quadratic_solve(1, -3, 2, &r1, &r2), 2u);
    EXPECT_EQ(r1, 1.0);
    EXPECT_EQ(r2, 2.0);
    // Widely separated roots: the textbook formula loses the small one entirely.
    EXPECT_EQ(plx_quadratic_solve(1, -1e9, 1, &r1, &r2), 2u);
    EXPECT_NEAR(r1, 1e-9, 1e-24);
    EXPECT_NEAR(r2, 1e9, 1e-6);
    EXPECT_EQ(plx_quadratic_solve(2, 4, 2, &r1, &r2), 2u);  // double root
    EXPECT_EQ(r1, -1.0);
    EXPECT_EQ(r2, -1.0);
    EXPECT_EQ(plx_quadratic_solve(1e200, 3e200, 2e200, &r1, &r2), 2u);  // no overflow
    EXPECT_NEAR(r1, -2.0, 1e-14);
    EXPECT_NEAR(r2, -1.0, 1e-14);
    r1 = r2 = 7;
    EXPECT_EQ(plx_quadratic_solve(1, 0, 1, &r1, &r2), 0u);
    EXPECT_EQ(r1, 7.0);
    EXPECT_EQ(plx_quadratic_solve(0, 2, -1, &r1, &r2), 1u);
    EXPECT_EQ(r1, 0.5);
    EXPECT_EQ(plx_quadratic_solve(0, 0, 1, &r1, &r2), 0u);
    EXPECT_EQ(plx_quadratic_solve(NAN, 1, 1, &r1, &r2), 0u);
    EXPECT_EQ(plx_quadratic_solve(1, 0, 0, nullptr, nullptr), 2u);
}

}  // namespace
