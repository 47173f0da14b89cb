// General matrices, vectors and structured square matrices, against dense Eigen references
// computed in the test.
#include <gtest/gtest.h>

#include "failure_check.hpp"

#include <Eigen/Dense>
#include <cmath>
#include <cstring>
#include <random>
#include <vector>

#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

using RMat = Eigen::Matrix<double, Eigen::Dynamic, Eigen::Dynamic, Eigen::RowMajor>;

int32_t origin_code()
{
    Plx_ErrorRecord rec;
    return plx_err_get_error(0, &rec) ? rec.code : 0;
}


Eigen::Map<RMat> view(Plx_Matrix &A) { return Eigen::Map<RMat>(A.data, A.rows, A.cols); }
Eigen::Map<Eigen::VectorXd> view(Plx_Vector &x) { return Eigen::Map<Eigen::VectorXd>(x.data, x.rows); }

RMat dense(const Plx_SquMatrix &A)
{
    RMat d(A.size, A.size);
    for (uint32_t r = 0; r < A.size; ++r)
        for (uint32_t c = 0; c < A.size; ++c) d(r, c) = plx_squmat_get(&A, r, c);
    return d;
}

// Heap records released at scope end (the library's own free functions).
struct Mat {
    Plx_Matrix *p;
    Mat(uint32_t r, uint32_t c, const RMat *v = nullptr) : p(plx_mat_new(r, c))
    {
        if (v) view(*p) = *v;
    }
    ~Mat() { plx_mat_free(p); }
    Eigen::Map<RMat> e() { return view(*p); }
};
struct Vec {
    Plx_Vector *p;
    explicit Vec(uint32_t n, const Eigen::VectorXd *v = nullptr) : p(plx_vec_new(n))
    {
        if (v) view(*p) = *v;
    }
    ~Vec() { plx_vec_free(p); }
    Eigen::Map<Eigen::VectorXd> e() { return view(*p); }
};
struct Squ {
    Plx_SquMatrix *p;
    Squ(Plx_SquMatrixType t, uint32_t n) : p(plx_squmat_new(t, n)) { plx_squmat_fill_zero(p); }
    Squ(Plx_SquMatrixType t, const RMat &v) : p(plx_squmat_new(t, uint32_t(v.rows())))
    {
        Plx_Matrix m;
        RMat copy = v;
        plx_mat_form_data(&m, uint32_t(v.rows()), uint32_t(v.cols()), copy.data());
        EXPECT_TRUE(plx_squmat_from_mat(&m, p));
    }
    ~Squ() { plx_squmat_free(p); }
};

class MatrixTest : public ::testing::Test {
protected:
    std::mt19937 rng{99};
    RMat random(int r, int c)
    {
        std::uniform_real_distribution<double> u(-1, 1);
        RMat m(r, c);
        for (int i = 0; i < r; ++i)
            for (int j = 0; j < c; ++j) m(i, j) = u(rng);
        return m;
    }
    RMat spd(int n)
    {
        RMat b = random(n, n);
        return b * b.transpose() + n * RMat::Identity(n, n);
    }
};

TEST_F(MatrixTest, RecordsResizeWithinCapacityAndRespectCallerData)
{
    Plx_Matrix A;
    ASSERT_EQ(plx_mat_form(&A, 3, 4), &A);
    EXPECT_EQ(A.owned, 0u);
    EXPECT_EQ(A.data_owned, 1u);
    double *block = A.data;
    for (int i = 0; i < 12; ++i) A.data[i] = i;
    ASSERT_TRUE(plx_mat_resize(&A, 2, 5));  // 10 <= 12: same block, values in place
    EXPECT_EQ(A.data, block);
    EXPECT_EQ(A.data[9], 9.0);
    ASSERT_TRUE(plx_mat_resize(&A, 5, 5));  // grows, keeping what was there
    EXPECT_GE(A.capacity, 25u);
    EXPECT_EQ(A.data[11], 11.0);
    plx_mat_free(&A);
    EXPECT_EQ(A.data, nullptr);

    double mine[6] = {1, 2, 3, 4, 5, 6};
    Plx_Vector x;
    ASSERT_EQ(plx_vec_form_data(&x, 6, mine), &x);
    ASSERT_TRUE(plx_vec_resize(&x, 4));
    EXPECT_EQ(x.data, mine);
    EXPECT_TRUE(fails_with(plx_vec_resize(&x, 7), PLX_ERROR_INCOMPATIBLE));
    EXPECT_EQ(x.rows, 4u);
    EXPECT_EQ(x.data, mine);
    plx_vec_free(&x);  // never frees caller data
    EXPECT_EQ(mine[5], 6.0);

    Plx_SquMatrix S;
    ASSERT_NE(plx_squmat_form(&S, PLX_SQUMAT_SYMMETRIC, 4), nullptr);
    double *sblock = S.data;
    ASSERT_TRUE(plx_squmat_resize(&S, PLX_SQUMAT_DIAGONAL, 9));
    EXPECT_EQ(S.data, sblock);
    EXPECT_TRUE(fails_with(plx_squmat_form(nullptr, PLX_SQUMAT_NONE, 2), PLX_ERROR_ILLEGAL_TYPE));
    plx_squmat_free(&S);
}

TEST_F(MatrixTest, FillAndReadValueLists)
{
    Mat A(2, 3);
    ASSERT_TRUE(plx_mat_fill_va(A.p, 1.0, 2.0, 3.0, 4.0, 5.0, 6.0));
    EXPECT_EQ(A.e()(1, 0), 4.0);
    double a = 0, b = 0, c = 0, d = 0, e = 0, f = 0;
    ASSERT_TRUE(plx_mat_read_va(A.p, &a, &b, &c, &d, &e, &f));
    EXPECT_EQ(f, 6.0);
    EXPECT_EQ(b, 2.0);
    a = -1;
    EXPECT_FALSE(plx_mat_read_va(A.p, &a, &b, &c, &d, &e, static_cast<double *>(nullptr)));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(a, -1.0);  // nothing written when one destination is null

    Vec x(3);
    ASSERT_TRUE(plx_vec_fill_va(x.p, 0.5, -1.0, 2.0));
    double out[3];
    ASSERT_TRUE(plx_vec_read(x.p, out));
    EXPECT_EQ(out[1], -1.0);

    // A symmetric matrix reads its lower triangle and mirrors it; a triangle ignores the rest.
    Squ S(PLX_SQUMAT_SYMMETRIC, 2), L(PLX_SQUMAT_UPPER_TRIANGULAR, 2), D(PLX_SQUMAT_DIAGONAL, 3);
    ASSERT_TRUE(plx_squmat_fill_va(S.p, 1.0, 99.0, 2.0, 3.0));
    EXPECT_EQ(plx_squmat_get(S.p, 0, 1), 2.0);
    const double vals[4] = {1, 2, 3, 4};
    ASSERT_TRUE(plx_squmat_fill(L.p, vals));
    EXPECT_EQ(plx_squmat_get(L.p, 1, 0), 0.0);
    EXPECT_EQ(plx_squmat_get(L.p, 0, 1), 2.0);
    ASSERT_TRUE(plx_squmat_fill_va(D.p, 7.0, 8.0, 9.0));
    double dv[3];
    ASSERT_TRUE(plx_squmat_read(D.p, dv));
    EXPECT_EQ(dv[2], 9.0);
    EXPECT_TRUE(std::isnan(plx_squmat_get(D.p, 3, 0)));
}

TEST_F(MatrixTest, ProductsMatchEigenIncludingAliasedOutputs)
{
    RMat a = random(4, 3), b = random(3, 5), c = random(4, 5), sq = random(3, 3);
    Mat A(4, 3, &a), B(3, 5, &b), C(4, 5), Ct(3, 5), D(4, 4), S(3, 3, &sq);
    ASSERT_TRUE(plx_mat_mult(A.p, B.p, C.p));
    EXPECT_LT((C.e() - a * b).cwiseAbs().maxCoeff(), 1e-14);
    Mat AC(4, 5, &c);
    ASSERT_TRUE(plx_mat_tmult(A.p, AC.p, Ct.p));
    EXPECT_LT((Ct.e() - a.transpose() * c).cwiseAbs().maxCoeff(), 1e-14);
    ASSERT_TRUE(plx_mat_multt(A.p, A.p, D.p));
    EXPECT_LT((D.e() - a * a.transpose()).cwiseAbs().maxCoeff(), 1e-14);
    // C = 2 A B - 3 C, then S = S S in place.
    ASSERT_TRUE(plx_mat_gemm(2.0, A.p, 0, B.p, 0, -3.0, AC.p));
    EXPECT_LT((AC.e() - (2 * a * b - 3 * c)).cwiseAbs().maxCoeff(), 1e-13);
    Mat E(5, 4);  // both operands transposed, old output values ignored with beta 0
    E.e().setConstant(NAN);
    ASSERT_TRUE(plx_mat_gemm(0.5, B.p, 1, A.p, 1, 0.0, E.p));
    EXPECT_LT((E.e() - 0.5 * b.transpose() * a.transpose()).cwiseAbs().maxCoeff(), 1e-14);
    ASSERT_TRUE(plx_mat_mult(S.p, S.p, S.p));
    EXPECT_LT((S.e() - sq * sq).cwiseAbs().maxCoeff(), 1e-14);

    Eigen::VectorXd xv = Eigen::VectorXd::LinSpaced(3, -1, 1), yv = Eigen::VectorXd::Ones(4);
    Vec x(3, &xv), y(4, &yv), z(3);
    ASSERT_TRUE(plx_mat_multv(A.p, x.p, y.p));
    EXPECT_LT((y.e() - a * xv).cwiseAbs().maxCoeff(), 1e-15);
    ASSERT_TRUE(plx_mat_tmultv(A.p, y.p, z.p));
    EXPECT_LT((z.e() - a.transpose() * (a * xv)).cwiseAbs().maxCoeff(), 1e-14);
    Eigen::VectorXd before = y.e();
    ASSERT_TRUE(plx_mat_gemv(-1.0, A.p, 0, x.p, 1.0, y.p));  // y -= A x
    EXPECT_LT(y.e().cwiseAbs().maxCoeff(), 1e-15);
    ASSERT_TRUE(plx_mat_multv(S.p, x.p, x.p));  // x = S x in place
    EXPECT_LT((x.e() - sq * sq * xv).cwiseAbs().maxCoeff(), 1e-14);

    // Sizes that do not fit: code 7, output untouched.
    RMat keep = C.e();
    EXPECT_FALSE(plx_mat_mult(B.p, A.p, C.p));
    Plx_ErrorRecord rec;
    ASSERT_TRUE(plx_err_get_error(0, &rec));
    EXPECT_EQ(rec.code, PLX_ERROR_INCOMPATIBLE);
    EXPECT_STREQ(rec.function, "plx_mat_gemm");
    ASSERT_TRUE(plx_err_get_error(1, &rec));
    EXPECT_STREQ(rec.function, "plx_mat_mult");
    EXPECT_EQ(C.e(), keep);
    EXPECT_TRUE(fails_with(plx_mat_multv(A.p, y.p, z.p), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(plx_mat_add(A.p, B.p, A.p), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(plx_mat_copy(A.p, nullptr), PLX_ERROR_ILLEGAL_ARGUMENT));
}

TEST_F(MatrixTest, ElementwiseTransposeAndBlocks)
{
    RMat a = random(3, 4), b = random(3, 4);
    Mat A(3, 4, &a), B(3, 4, &b), C(3, 4), At(4, 3), Blk(2, 2);
    ASSERT_TRUE(plx_mat_sub(A.p, B.p, C.p));
    EXPECT_EQ(C.e(), a - b);
    ASSERT_TRUE(plx_mat_add(C.p, B.p, C.p));
    EXPECT_LT((C.e() - a).cwiseAbs().maxCoeff(), 1e-15);
    ASSERT_TRUE(plx_mat_scale(A.p, -2.0, C.p));
    EXPECT_EQ(C.e(), -2.0 * a);
    ASSERT_TRUE(plx_mat_transpose(A.p, At.p));
    EXPECT_EQ(At.e(), a.transpose());
    ASSERT_TRUE(plx_mat_extract(A.p, 1, 2, Blk.p));
    EXPECT_EQ(Blk.e(), a.block(1, 2, 2, 2));
    ASSERT_TRUE(plx_mat_insert(B.p, 0, 0, Blk.p));
    EXPECT_EQ(B.e().block(0, 0, 2, 2), a.block(1, 2, 2, 2));
    EXPECT_EQ(B.e()(2, 3), b(2, 3));
    EXPECT_TRUE(fails_with(plx_mat_extract(A.p, 2, 0, Blk.p), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(plx_mat_insert(A.p, 0, 3, Blk.p), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(plx_mat_transpose(A.p, C.p), PLX_ERROR_INCOMPATIBLE));
    // A square matrix transposed onto itself.
    RMat s = random(3, 3);
    Mat S(3, 3, &s);
    ASSERT_TRUE(plx_mat_transpose(S.p, S.p));
    EXPECT_EQ(S.e(), s.transpose());
}

TEST_F(MatrixTest, VectorArithmetic)
{
    Eigen::VectorXd a(4), b(4);
    a << 1e200, 2e200, -2e200, 4e200;
    b << 1, -1, 0.5, 2;
    Vec x(4, &a), y(4, &b), z(4), part(2);
    double n = 0, d = 0;
    ASSERT_TRUE(plx_vec_norm(x.p, &n));
    EXPECT_NEAR(n, 5e200, 1e186);  // no overflow in the squares
    ASSERT_TRUE(plx_vec_dot(x.p, y.p, &d));
    EXPECT_DOUBLE_EQ(d, 1e200 - 2e200 - 1e200 + 8e200);
    ASSERT_TRUE(plx_vec_sub(y.p, y.p, z.p));
    EXPECT_EQ(z.e(), Eigen::VectorXd::Zero(4));
    ASSERT_TRUE(plx_vec_extract(y.p, 2, part.p));
    ASSERT_TRUE(plx_vec_insert(z.p, 0, part.p));
    EXPECT_EQ(z.e()(0), 0.5);
    EXPECT_EQ(z.e()(1), 2.0);
    EXPECT_TRUE(fails_with(plx_vec_insert(z.p, 3, part.p), PLX_ERROR_INCOMPATIBLE));
    EXPECT_TRUE(fails_with(plx_vec_dot(x.p, part.p, &d), PLX_ERROR_INCOMPATIBLE));
}

TEST_F(MatrixTest, StructureTypesHoldWhatTheyCanAndRefuseTheRest)
{
    RMat s = spd(3), l = random(3, 3).triangularView<Eigen::Lower>();
    Squ S(PLX_SQUMAT_SYMMETRIC, s), L(PLX_SQUMAT_LOWER_TRIANGULAR, l), D(PLX_SQUMAT_DIAGONAL, 3),
        I(PLX_SQUMAT_SCALED_IDENTITY, 3), G(PLX_SQUMAT_GENERIC, 3), U(PLX_SQUMAT_UPPER_TRIANGULAR, 3);
    ASSERT_TRUE(plx_squmat_fill_va(D.p, 1.0, 2.0, 3.0));
    ASSERT_TRUE(plx_squmat_fill_scaled_identity(I.p, 0.5));
    EXPECT_EQ(dense(*I.p), 0.5 * RMat::Identity(3, 3));

    ASSERT_TRUE(plx_squmat_add(S.p, D.p, S.p));  // symmetric + diagonal stays symmetric
    EXPECT_EQ(dense(*S.p), s + RMat(dense(*D.p)));
    ASSERT_TRUE(plx_squmat_sub(L.p, I.p, L.p));
    EXPECT_EQ(dense(*L.p), l - 0.5 * RMat::Identity(3, 3));
    ASSERT_TRUE(plx_squmat_add(S.p, L.p, G.p));  // mixed structures need a generic result
    EXPECT_EQ(dense(*G.p), dense(*S.p) + dense(*L.p));
    RMat keep = dense(*S.p);
    EXPECT_TRUE(fails_with(plx_squmat_add(S.p, L.p, S.p), PLX_ERROR_UNSUPPORTED));
    EXPECT_EQ(dense(*S.p), keep);
    EXPECT_TRUE(fails_with(plx_squmat_copy(S.p, D.p), PLX_ERROR_UNSUPPORTED));
    ASSERT_TRUE(plx_squmat_copy(I.p, D.p));
    EXPECT_EQ(dense(*D.p), dense(*I.p));
    ASSERT_TRUE(plx_squmat_transpose(L.p, U.p));
    EXPECT_EQ(dense(*U.p), dense(*L.p).transpose());
    EXPECT_TRUE(fails_with(plx_squmat_transpose(L.p, L.p), PLX_ERROR_UNSUPPORTED));

    EXPECT_TRUE(fails_with(plx_squmat_set(D.p, 0, 1, 1.0), PLX_ERROR_UNSUPPORTED));
    EXPECT_TRUE(fails_with(plx_squmat_set(L.p, 0, 2, 1.0), PLX_ERROR_UNSUPPORTED));
    EXPECT_TRUE(fails_with(plx_squmat_set(S.p, 3, 0, 1.0), PLX_ERROR_ILLEGAL_ARGUMENT));
    ASSERT_TRUE(plx_squmat_set(S.p, 0, 2, 42.0));
    EXPECT_EQ(plx_squmat_get(S.p, 2, 0), 42.0);
    ASSERT_TRUE(plx_squmat_set(I.p, 1, 1, 3.0));
    EXPECT_EQ(plx_squmat_get(I.p, 2, 2), 3.0);

    Squ small(PLX_SQUMAT_SYMMETRIC, 2);
    EXPECT_TRUE(fails_with(plx_squmat_add(S.p, small.p, S.p), PLX_ERROR_INCOMPATIBLE));
}

TEST_F(MatrixTest, SquareProductsForEveryStructure)
{
    const Plx_SquMatrixType types[] = {PLX_SQUMAT_SYMMETRIC, PLX_SQUMAT_DIAGONAL, PLX_SQUMAT_SCALED_IDENTITY,
                                       PLX_SQUMAT_LOWER_TRIANGULAR, PLX_SQUMAT_UPPER_TRIANGULAR, PLX_SQUMAT_GENERIC};
    RMat g = random(4, 4), b = random(4, 3);
    Eigen::VectorXd xv = Eigen::VectorXd::LinSpaced(4, -2, 1);
    for (Plx_SquMatrixType t : types) {
        Squ A(t, g);
        RMat a = dense(*A.p);
        Vec x(4, &xv), y(4);
        Mat B(4, 3, &b), C(4, 3);
        ASSERT_TRUE(plx_squmat_multv(A.p, x.p, y.p));
        EXPECT_LT((y.e() - a * xv).cwiseAbs().maxCoeff(), 1e-14) << t;
        ASSERT_TRUE(plx_squmat_tmultv(A.p, x.p, x.p));
        EXPECT_LT((x.e() - a.transpose() * xv).cwiseAbs().maxCoeff(), 1e-14) << t;
        ASSERT_TRUE(plx_squmat_multm(A.p, B.p, C.p));
        EXPECT_LT((C.e() - a * b).cwiseAbs().maxCoeff(), 1e-14) << t;
        ASSERT_TRUE(plx_squmat_tmultm(A.p, B.p, B.p));
        EXPECT_LT((B.e() - a.transpose() * b).cwiseAbs().maxCoeff(), 1e-14) << t;
        double q = 0;
        Vec x2(4, &xv);
        ASSERT_TRUE(plx_squmat_quadform(A.p, x2.p, &q));
        EXPECT_NEAR(q, xv.dot(a * xv), 1e-13) << t;
        Mat M(4, 4);
        ASSERT_TRUE(plx_squmat_to_mat(A.p, M.p));
        EXPECT_EQ(M.e(), a) << t;
    }
}

TEST_F(MatrixTest, SymmetricUpdatesStayExactlySymmetric)
{
    RMat j = random(5, 4), n = spd(5), bm = random(2, 4);
    Eigen::VectorXd xv = Eigen::VectorXd::LinSpaced(4, 0.3, -1.7);
    Squ A(PLX_SQUMAT_SYMMETRIC, 4), N(PLX_SQUMAT_SYMMETRIC, n), W(PLX_SQUMAT_DIAGONAL, 5);
    ASSERT_TRUE(plx_squmat_fill_va(W.p, 1.0, 2.0, 3.0, 4.0, 5.0));
    Mat J(5, 4, &j), B(2, 4, &bm);
    Vec x(4, &xv);
    ASSERT_TRUE(plx_squmat_add_sandwich(A.p, 1.0, J.p, N.p));
    ASSERT_TRUE(plx_squmat_add_sandwich(A.p, -0.5, J.p, W.p));
    ASSERT_TRUE(plx_squmat_add_rank(A.p, 2.0, B.p));
    ASSERT_TRUE(plx_squmat_add_outer(A.p, -1.0, x.p));
    RMat expect = j.transpose() * n * j - 0.5 * j.transpose() * RMat(dense(*W.p)) * j +
                  2.0 * bm.transpose() * bm - xv * xv.transpose();
    RMat got = dense(*A.p);
    EXPECT_LT((got - expect).cwiseAbs().maxCoeff(), 1e-12);
    EXPECT_EQ(got, got.transpose());  // bit-for-bit

    // A generic matrix takes the same symmetric update on top of its own values.
    RMat g0 = random(4, 4);
    Squ G0(PLX_SQUMAT_GENERIC, g0);
    ASSERT_TRUE(plx_squmat_add_sandwich(G0.p, 1.0, J.p, N.p));
    ASSERT_TRUE(plx_squmat_add_outer(G0.p, 3.0, x.p));
    EXPECT_LT((dense(*G0.p) - (g0 + j.transpose() * n * j + 3.0 * xv * xv.transpose())).cwiseAbs().maxCoeff(), 1e-12);

    Squ D(PLX_SQUMAT_DIAGONAL, 4);
    EXPECT_TRUE(fails_with(plx_squmat_add_outer(D.p, 1.0, x.p), PLX_ERROR_UNSUPPORTED));
    Squ G(PLX_SQUMAT_GENERIC, 4);
    EXPECT_FALSE(plx_squmat_add_sandwich(A.p, 1.0, J.p, G.p));  // N must be symmetric-like
    EXPECT_EQ(origin_code(), PLX_ERROR_UNSUPPORTED);
    Mat Bad(2, 3);
    EXPECT_TRUE(fails_with(plx_squmat_add_rank(A.p, 1.0, Bad.p), PLX_ERROR_INCOMPATIBLE));
}

TEST_F(MatrixTest, CholeskySolvesAndInverses)
{
    const int n = 6;
    RMat a = spd(n), b = random(n, 2);
    Squ A(PLX_SQUMAT_SYMMETRIC, a), L(PLX_SQUMAT_SYMMETRIC, n);
    ASSERT_TRUE(plx_squmat_cholesky(A.p, L.p));
    EXPECT_EQ(L.p->type, PLX_SQUMAT_LOWER_TRIANGULAR);
    RMat l = dense(*L.p);
    EXPECT_LT((l * l.transpose() - a).cwiseAbs().maxCoeff(), 1e-13);
    EXPECT_EQ(RMat(l.triangularView<Eigen::StrictlyUpper>()), RMat::Zero(n, n));

    // Forward and backward solves: L^-T L^-1 b = A^-1 b.
    Mat B(n, 2, &b), X(n, 2);
    ASSERT_TRUE(plx_squmat_trisolve_m(L.p, 0, B.p, X.p));
    EXPECT_LT((l * X.e() - b).cwiseAbs().maxCoeff(), 1e-13);
    ASSERT_TRUE(plx_squmat_trisolve_m(L.p, 1, X.p, X.p));
    EXPECT_LT((a * X.e() - b).cwiseAbs().maxCoeff(), 1e-12);
    Eigen::VectorXd bv = b.col(0);
    Vec v(n, &bv);
    ASSERT_TRUE(plx_squmat_trisolve_v(L.p, 0, v.p, v.p));
    ASSERT_TRUE(plx_squmat_trisolve_v(L.p, 1, v.p, v.p));
    EXPECT_LT((v.e() - X.e().col(0)).cwiseAbs().maxCoeff(), 1e-13);
    Squ U(PLX_SQUMAT_UPPER_TRIANGULAR, RMat(l.transpose()));
    ASSERT_TRUE(plx_squmat_trisolve_v(U.p, 1, v.p, v.p));  // U^T = L
    EXPECT_LT((l * v.e() - X.e().col(0)).cwiseAbs().maxCoeff(), 1e-13);

    Squ Ainv(PLX_SQUMAT_GENERIC, n), Cinv(PLX_SQUMAT_SYMMETRIC, n);
    ASSERT_TRUE(plx_squmat_cholesky_invert(L.p, Cinv.p));
    EXPECT_LT((a * dense(*Cinv.p) - RMat::Identity(n, n)).cwiseAbs().maxCoeff(), 1e-12);
    ASSERT_TRUE(plx_squmat_invert(A.p, Ainv.p));
    EXPECT_EQ(Ainv.p->type, PLX_SQUMAT_SYMMETRIC);
    EXPECT_LT((dense(*Ainv.p) - dense(*Cinv.p)).cwiseAbs().maxCoeff(), 1e-13);
    RMat g = random(n, n) + 3 * RMat::Identity(n, n);
    Squ G(PLX_SQUMAT_GENERIC, g), Tl(PLX_SQUMAT_LOWER_TRIANGULAR, l), D(PLX_SQUMAT_DIAGONAL, 2);
    ASSERT_TRUE(plx_squmat_invert(G.p, G.p));
    EXPECT_LT((g * dense(*G.p) - RMat::Identity(n, n)).cwiseAbs().maxCoeff(), 1e-12);
    ASSERT_TRUE(plx_squmat_invert(Tl.p, Tl.p));
    EXPECT_EQ(Tl.p->type, PLX_SQUMAT_LOWER_TRIANGULAR);
    EXPECT_LT((l * dense(*Tl.p) - RMat::Identity(n, n)).cwiseAbs().maxCoeff(), 1e-12);

    // In place, and the structured types factorise to themselves.
    ASSERT_TRUE(plx_squmat_cholesky(A.p, A.p));
    EXPECT_EQ(dense(*A.p), l);
    ASSERT_TRUE(plx_squmat_fill_va(D.p, 4.0, 9.0));
    ASSERT_TRUE(plx_squmat_cholesky(D.p, D.p));
    EXPECT_EQ(D.p->type, PLX_SQUMAT_DIAGONAL);
    EXPECT_EQ(plx_squmat_get(D.p, 1, 1), 3.0);
}

TEST_F(MatrixTest, FactorisationFailuresCarryTheirCodesAndChangeNothing)
{
    RMat indefinite = RMat::Identity(3, 3);
    indefinite(1, 1) = -2;
    Squ A(PLX_SQUMAT_SYMMETRIC, indefinite);
    EXPECT_TRUE(fails_with(plx_squmat_cholesky(A.p, A.p), PLX_ERROR_ILLEGAL_ARGUMENT));
    EXPECT_EQ(A.p->type, PLX_SQUMAT_SYMMETRIC);
    EXPECT_EQ(dense(*A.p), indefinite);
    Squ Out(PLX_SQUMAT_SYMMETRIC, 3);
    EXPECT_TRUE(fails_with(plx_squmat_invert(A.p, Out.p), PLX_ERROR_ILLEGAL_ARGUMENT));

    RMat singular = random(3, 3);
    singular.row(2) = singular.row(0) + singular.row(1);
    Squ G(PLX_SQUMAT_GENERIC, singular), Gi(PLX_SQUMAT_GENERIC, 3);
    EXPECT_TRUE(fails_with(plx_squmat_invert(G.p, Gi.p), PLX_ERROR_DIVISION_BY_ZERO));
    RMat zero_diag = RMat::Identity(3, 3);
    zero_diag(1, 1) = 0;
    Squ T(PLX_SQUMAT_LOWER_TRIANGULAR, zero_diag);
    Eigen::VectorXd ones = Eigen::VectorXd::Ones(3);
    Vec v(3, &ones);
    EXPECT_TRUE(fails_with(plx_squmat_trisolve_v(T.p, 0, v.p, v.p), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(v.e(), ones);
    EXPECT_TRUE(fails_with(plx_squmat_trisolve_v(G.p, 0, v.p, v.p), PLX_ERROR_UNSUPPORTED));  // not triangular
    EXPECT_TRUE(fails_with(plx_squmat_cholesky(G.p, Gi.p), PLX_ERROR_UNSUPPORTED));
    Plx_SquMatrix broken = *G.p;
    const int32_t unknown = 77;  // what a C caller may leave in the field
    std::memcpy(&broken.type, &unknown, sizeof unknown);
    EXPECT_TRUE(fails_with(plx_squmat_cholesky(&broken, Gi.p), PLX_ERROR_ILLEGAL_TYPE));
}

TEST_F(MatrixTest, EigenDecompositionSortedPairs)
{
    const int n = 5;
    RMat a = spd(n) - 4 * RMat::Identity(n, n);
    Squ A(PLX_SQUMAT_SYMMETRIC, a), D(PLX_SQUMAT_DIAGONAL, 3);
    Vec vals(n);
    Mat vecs(n, n);
    ASSERT_TRUE(plx_squmat_eigen(A.p, vals.p, vecs.p));
    Eigen::SelfAdjointEigenSolver<RMat> ref(a);
    for (int i = 0; i < n; ++i) {
        if (i > 0) {
            EXPECT_LE(vals.e()(i - 1), vals.e()(i));
        }
        EXPECT_NEAR(vals.e()(i), ref.eigenvalues()(i), 1e-12);
        Eigen::VectorXd v = vecs.e().col(i);
        EXPECT_NEAR(v.norm(), 1.0, 1e-13);
        EXPECT_LT((a * v - vals.e()(i) * v).norm(), 1e-12);
    }
    ASSERT_TRUE(plx_squmat_fill_va(D.p, 3.0, -1.0, 2.0));
    Vec dv(3);
    Mat dvec(3, 3);
    ASSERT_TRUE(plx_squmat_eigen(D.p, dv.p, dvec.p));
    EXPECT_EQ(dv.e(), Eigen::Vector3d(-1, 2, 3));
    EXPECT_EQ(dvec.e().col(0), Eigen::Vector3d(0, 1, 0));
    Squ L(PLX_SQUMAT_LOWER_TRIANGULAR, 3);
    EXPECT_TRUE(fails_with(plx_squmat_eigen(L.p, dv.p, dvec.p), PLX_ERROR_UNSUPPORTED));
    EXPECT_TRUE(fails_with(plx_squmat_eigen(A.p, dv.p, dvec.p), PLX_ERROR_INCOMPATIBLE));
}

}  // namespace
