// Homography and affine fits from point pairs, the incremental least-squares solver and
// point normalisation.
#include <Eigen/Cholesky>
#include <Eigen/Eigenvalues>
#include <cmath>
#include <cstdlib>
#include <cstring>

#include "matrix_internal.hpp"
#include "pellux/detail/util.hpp"
#include "pellux/error.h"
#include "pellux/geometry.h"

namespace {

using RowMajor9 = Eigen::Matrix<double, 9, 9, Eigen::RowMajor>;

// A pivot of the equilibrated normal equations below this is taken as a rank deficiency:
// the unknowns it belongs to are (numerically) not determined by the equations.
constexpr double kPivotTolerance = 1e-13;
// Second-smallest to largest eigenvalue of the equilibrated homography system below which
// the fit is taken as undetermined: degenerate sets sit at rounding level (1e-16), while
// four points in general position give 1e-7 or more even in raw pixel units.
constexpr double kDegenerateRatio = 1e-12;

// Adds w a a^T to the lower and upper triangle of the n x n row-major S.
inline void add_outer(double *S, const double *a, double w, int n)
{
    for (int r = 0; r < n; ++r) {
        double wa = w * a[r];
        if (wa == 0.0) continue;
        double *row = S + r * n;
        for (int c = 0; c < n; ++c) row[c] += wa * a[c];
    }
}

bool null_argument(const char *function)
{
    PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
    return false;
}

}  // namespace

extern "C" {

// ---- incremental least squares ----

PLX_API Plx_PseudoInverseSolver *plx_psinv_form(Plx_PseudoInverseSolver *solver, uint32_t unknowns)
{
    if (unknowns == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "no unknowns", 0);
        return nullptr;
    }
    std::size_t n = unknowns;
    plx::HeapPtr<double> block(PLX_ALLOC(double, n * n + n));
    if (!block) return nullptr;
    if (solver == nullptr) {
        solver = PLX_ALLOC(Plx_PseudoInverseSolver, 1);
        if (solver == nullptr) return nullptr;
        solver->owned = 1;
    } else {
        solver->owned = 0;
    }
    solver->unknowns = unknowns;
    solver->AtA = block.release();
    solver->Atb = solver->AtA + n * n;
    plx_psinv_reset(solver);
    return solver;
}

PLX_API void plx_psinv_reset(Plx_PseudoInverseSolver *solver)
{
    if (solver == nullptr || solver->AtA == nullptr) return;
    std::size_t n = solver->unknowns;
    std::memset(solver->AtA, 0, (n * n + n) * sizeof(double));
    solver->equations = 0;
}

PLX_API Plx_Bool plx_psinv_increment(Plx_PseudoInverseSolver *solver, const double *row, double rhs,
                                     double weight)
{
    if (solver == nullptr || solver->AtA == nullptr || row == nullptr) return null_argument(__func__);
    if (!std::isfinite(weight) || !std::isfinite(rhs)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "weight or right-hand side not finite", 0);
        return PLX_FALSE;
    }
    int n = static_cast<int>(solver->unknowns);
    add_outer(solver->AtA, row, weight, n);
    for (int i = 0; i < n; ++i) solver->Atb[i] += weight * rhs * row[i];
    ++solver->equations;
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_psinv_solve(Plx_PseudoInverseSolver *solver, double *solution)
{
    if (solver == nullptr || solver->AtA == nullptr || solution == nullptr) return null_argument(__func__);
    if (solver->equations < solver->unknowns) {
        PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "fewer equations than unknowns", solver->equations);
        return PLX_FALSE;
    }
    int n = static_cast<int>(solver->unknowns);
    using Mat = Eigen::Matrix<double, Eigen::Dynamic, Eigen::Dynamic, Eigen::RowMajor>;
    Eigen::Map<const Mat> AtA(solver->AtA, n, n);
    Eigen::Map<const Eigen::VectorXd> Atb(solver->Atb, n);
    // Equilibrate so the rank test does not depend on the units of the unknowns.
    Eigen::VectorXd d(n);
    for (int i = 0; i < n; ++i) {
        double a = AtA(i, i);
        if (!(a > 0.0) || !std::isfinite(a)) {
            PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "unknown not constrained by the equations", i);
            return PLX_FALSE;
        }
        d(i) = 1.0 / std::sqrt(a);
    }
    Mat S = d.asDiagonal() * AtA * d.asDiagonal();
    Eigen::LLT<Mat> llt(S);
    bool singular = llt.info() != Eigen::Success;
    if (!singular) {
        const Mat &L = llt.matrixLLT();
        for (int i = 0; i < n; ++i)
            if (!(L(i, i) * L(i, i) > kPivotTolerance)) singular = true;
    }
    if (singular) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "singular system", 0);
        return PLX_FALSE;
    }
    Eigen::VectorXd p = d.asDiagonal() * llt.solve(d.asDiagonal() * Atb);
    if (!p.allFinite()) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "singular system", 0);
        return PLX_FALSE;
    }
    Eigen::Map<Eigen::VectorXd>(solution, n) = p;
    return PLX_TRUE;
}

PLX_API void plx_psinv_free(Plx_PseudoInverseSolver *solver)
{
    if (solver == nullptr) return;
    std::free(solver->AtA);
    solver->AtA = nullptr;
    solver->Atb = nullptr;
    if (solver->owned) std::free(solver);
}

// ---- homography ----

PLX_API Plx_Bool plx_homog33_increment_p(Plx_SquMatrix *A, const Plx_Vector3 *x, const Plx_Vector3 *xp)
{
    if (A == nullptr || A->data == nullptr || x == nullptr || xp == nullptr) return null_argument(__func__);
    if (plx::squmat_raw_type(A) != PLX_SQUMAT_SYMMETRIC || A->size != 9) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "accumulator must be a 9x9 symmetric matrix", A->size);
        return PLX_FALSE;
    }
    // xp x (H x) = 0: the first two components give two equations linear in the entries of H
    // (row-major h), each a row a with a . h = 0.
    const double X[3] = {x->x, x->y, x->z};
    const double u = xp->x, v = xp->y, s = xp->z;
    double a1[9], a2[9];
    for (int i = 0; i < 3; ++i) {
        a1[i] = 0.0;
        a1[3 + i] = -s * X[i];
        a1[6 + i] = v * X[i];
        a2[i] = s * X[i];
        a2[3 + i] = 0.0;
        a2[6 + i] = -u * X[i];
    }
    add_outer(A->data, a1, 1.0, 9);
    add_outer(A->data, a2, 1.0, 9);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_homog33_solve(const Plx_SquMatrix *A, uint32_t equations, Plx_Matrix33 *H)
{
    if (A == nullptr || A->data == nullptr || H == nullptr) return null_argument(__func__);
    if (plx::squmat_raw_type(A) != PLX_SQUMAT_SYMMETRIC || A->size != 9) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "accumulator must be a 9x9 symmetric matrix", A->size);
        return PLX_FALSE;
    }
    if (equations < 8) {
        PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "fewer than 8 equations", equations);
        return PLX_FALSE;
    }
    Eigen::Map<const RowMajor9> S(A->data);
    if (!S.allFinite()) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "accumulator not finite", 0);
        return PLX_FALSE;
    }
    Eigen::SelfAdjointEigenSolver<Eigen::Matrix<double, 9, 9>> solver(S.transpose());
    if (solver.info() != Eigen::Success) {
        PLX_ERR_START(PLX_ERROR_NO_CONVERGENCE, "eigen-decomposition did not converge", 0);
        return PLX_FALSE;
    }
    // A second (near-)zero eigenvalue leaves a family of solutions: the pairs do not fix H
    // (coincident or collinear points). The raw eigenvalues cannot tell that apart from a
    // merely badly scaled system (pixel coordinates square the spread of the entries), so
    // the test is made on the Jacobi-equilibrated matrix, whose spectrum does not depend on
    // the units of the nine unknowns.
    Eigen::Matrix<double, 9, 1> d;
    for (int i = 0; i < 9; ++i) d(i) = S(i, i) > 0.0 ? 1.0 / std::sqrt(S(i, i)) : 0.0;
    Eigen::Matrix<double, 9, 9> E = d.asDiagonal() * S.transpose() * d.asDiagonal();
    Eigen::SelfAdjointEigenSolver<Eigen::Matrix<double, 9, 9>> scaled(E, Eigen::EigenvaluesOnly);
    const auto &ev = scaled.eigenvalues();
    if (scaled.info() != Eigen::Success || !(ev(8) > 0.0) || ev(1) <= kDegenerateRatio * ev(8)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "point pairs do not determine a homography", 0);
        return PLX_FALSE;
    }
    Eigen::Matrix<double, 9, 1> h = solver.eigenvectors().col(0);
    // The sign of an eigenvector is arbitrary; make the largest entry positive so the same
    // data always gives the same H.
    Eigen::Index big;
    h.cwiseAbs().maxCoeff(&big);
    if (h(big) < 0) h = -h;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) H->m[r][c] = h(3 * r + c);
    return PLX_TRUE;
}

// ---- affine map ----

PLX_API Plx_Bool plx_affine33_increment_p(Plx_PseudoInverseSolver *solver, const Plx_Vector3 *x,
                                          const Plx_Vector3 *xp)
{
    if (solver == nullptr || x == nullptr || xp == nullptr) return null_argument(__func__);
    if (solver->unknowns != 6) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "affine fit needs a six-unknown solver", solver->unknowns);
        return PLX_FALSE;
    }
    if (x->z == 0.0 || xp->z == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "point at infinity", 0);
        return PLX_FALSE;
    }
    double u = x->x / x->z, v = x->y / x->z;
    const double r1[6] = {u, v, 1.0, 0.0, 0.0, 0.0};
    const double r2[6] = {0.0, 0.0, 0.0, u, v, 1.0};
    if (!plx_psinv_increment(solver, r1, xp->x / xp->z, 1.0) ||
        !plx_psinv_increment(solver, r2, xp->y / xp->z, 1.0)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_affine33_solve(Plx_PseudoInverseSolver *solver, uint32_t equations, Plx_Matrix23 *A)
{
    if (solver == nullptr || A == nullptr) return null_argument(__func__);
    if (solver->unknowns != 6) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "affine fit needs a six-unknown solver", solver->unknowns);
        return PLX_FALSE;
    }
    if (equations < 6) {
        PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "fewer than 6 equations", equations);
        return PLX_FALSE;
    }
    double p[6];
    if (!plx_psinv_solve(solver, p)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    for (int i = 0; i < 6; ++i) A->m[i / 3][i % 3] = p[i];
    return PLX_TRUE;
}

// ---- normalisation ----

PLX_API Plx_Bool plx_points_normalise(const Plx_Vector3 *points, uint32_t n, double max_scale,
                                      double tolerance, Plx_Vector3 *out, Plx_Matrix33 *T)
{
    if (points == nullptr || T == nullptr) return null_argument(__func__);
    if (n == 0) {
        PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "no points", 0);
        return PLX_FALSE;
    }
    double cx = 0, cy = 0;
    for (uint32_t i = 0; i < n; ++i) {
        if (points[i].z == 0.0) {
            PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "point at infinity", i);
            return PLX_FALSE;
        }
        cx += points[i].x / points[i].z;
        cy += points[i].y / points[i].z;
    }
    cx /= n;
    cy /= n;
    double ss = 0;
    for (uint32_t i = 0; i < n; ++i) {
        double dx = points[i].x / points[i].z - cx, dy = points[i].y / points[i].z - cy;
        ss += dx * dx + dy * dy;
    }
    double rms = std::sqrt(ss / n);
    if (!(rms >= tolerance) || !std::isfinite(rms) || rms == 0.0) {
        PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "points do not spread", 0);
        return PLX_FALSE;
    }
    double s = std::sqrt(2.0) / rms;
    if (s > max_scale) s = max_scale;
    Plx_Matrix33 t = {{{s, 0.0, -s * cx}, {0.0, s, -s * cy}, {0.0, 0.0, 1.0}}};
    if (out != nullptr)
        for (uint32_t i = 0; i < n; ++i) {
            Plx_Vector3 p = points[i];
            out[i] = {s * p.x - s * cx * p.z, s * p.y - s * cy * p.z, p.z};
        }
    *T = t;
    return PLX_TRUE;
}

}  // extern "C"
