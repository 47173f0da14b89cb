// Square roots of 2x2 and 3x3 matrices and fractional powers of 3x3 matrices through a chain
// of repeated square roots, which interpolate motion geometrically between anchor frames.
#include <algorithm>
#include <cstring>
#include <limits>

#include "pellux/fixed.h"
#include "stabilise/stabilise_internal.hpp"

namespace {

using plano::stabilise::given;

// Newton's updates from the identity stop once the squared size of an update falls below this.
constexpr double kConvergedStep = 1e-12;
constexpr int kMaxUpdates = 1000;
// Above this the power table alone would need gigabytes.
constexpr uint32_t kMaxLevels = 24;

template <class M>
struct Ops;
template <>
struct Ops<Plx_Matrix22> {
    static constexpr int n = 2;
    static void ident(Plx_Matrix22 *a) { plx_mat22_ident_s(a); }
    static Plx_Bool invert(const Plx_Matrix22 *a, Plx_Matrix22 *ai) { return plx_mat22_invert_s(a, ai); }
    static void mult(const Plx_Matrix22 *a, const Plx_Matrix22 *b, Plx_Matrix22 *ab) { plx_mat22_rmultm22_s(a, b, ab); }
};
template <>
struct Ops<Plx_Matrix33> {
    static constexpr int n = 3;
    static void ident(Plx_Matrix33 *a) { plx_mat33_ident_s(a); }
    static Plx_Bool invert(const Plx_Matrix33 *a, Plx_Matrix33 *ai) { return plx_mat33_invert_s(a, ai); }
    static void mult(const Plx_Matrix33 *a, const Plx_Matrix33 *b, Plx_Matrix33 *ab) { plx_mat33_rmultm33_s(a, b, ab); }
};

// X := X + D with D = (A X^-1 - X) / 2 until D is small, which converges to the principal root when A has no
// eigenvalue on the closed negative real axis. Registers its failure under caller.
template <class M>
bool newton_square_root(const M &A, M &root, const char *caller)
{
    using O = Ops<M>;
    M X, Xinv, AXinv;
    O::ident(&X);
    for (int updates = 0;; ++updates) {
        if (!O::invert(&X, &Xinv)) {
            plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "singular iterate", updates);
            return false;
        }
        O::mult(&A, &Xinv, &AXinv);
        M D;
        double size = 0.0;
        for (int r = 0; r < O::n; ++r)
            for (int c = 0; c < O::n; ++c) {
                D.m[r][c] = 0.5 * (AXinv.m[r][c] - X.m[r][c]);
                size += D.m[r][c] * D.m[r][c];
            }
        // Nothing finite follows from a non-finite step; stop rather than spin.
        if (!(size < kConvergedStep) && (updates == kMaxUpdates || !std::isfinite(size))) {
            PLX_ERR_START_AS(caller, PLX_ERROR_NO_CONVERGENCE, "square root did not converge", updates);
            return false;
        }
        for (int r = 0; r < O::n; ++r)
            for (int c = 0; c < O::n; ++c) X.m[r][c] += D.m[r][c];
        // The step that passes the test is still taken: the iterate before it can be 1e-6
        // off, and the general root compounds that error through its chain; after it the
        // quadratic convergence leaves rounding error.
        if (size < kConvergedStep) {
            root = X;
            return true;
        }
    }
}

// Makes power j from its lowest set bit at or above `bit` upwards: M^(j/2^L) =
// root[b] * M^((j - 2^b)/2^L). The remainder has no bit below b + 1.
void make_power(Matrix33GeneralRoot &g, uint32_t j, uint32_t bit)
{
    if (g.computed[j]) return;
    uint32_t b = bit;
    while ((j & (1u << b)) == 0) ++b;
    const uint32_t rest = j - (1u << b);
    make_power(g, rest, b + 1);
    plx_mat33_rmultm33_s(&g.root[b], &g.power[rest], &g.power[j]);
    g.computed[j] = 1;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bMatrix22SquareRoot(const Plx_Matrix22 *A, Plx_Matrix22 *root)
{
    if (!given(__func__, A, root)) return 0;
    return newton_square_root(*A, *root, __func__);
}

PLANO_API Plx_Bool bMatrix33SquareRoot(const Plx_Matrix33 *A, Plx_Matrix33 *root)
{
    if (!given(__func__, A, root)) return 0;
    return newton_square_root(*A, *root, __func__);
}

PLANO_API Plx_Bool bSymMatrix22SquareRoot(const Plx_Matrix22 *A, Plx_Matrix22 *root)
{
    if (!given(__func__, A, root)) return 0;
    Plx_Vector2 values;
    Plx_Matrix22 V;
    if (!plx_symmat22_eigen(A, &values, &V)) {
        PLX_ERR_PASS();
        return 0;
    }
    // A singular semi-definite matrix gives a zero eigenvalue that rounding may push just
    // below zero; only a clearly negative one has no real root.
    const double tolerance = 64.0 * std::numeric_limits<double>::epsilon() *
                             std::max(std::fabs(values.x), std::fabs(values.y));
    double lambda[2] = {values.x, values.y};
    for (double &l : lambda) {
        if (l < -tolerance) {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "negative eigenvalue", 0);
            return 0;
        }
        l = std::sqrt(std::max(l, 0.0));
    }
    // V diag(sqrt(lambda)) V^T; symmetric by construction.
    Plx_Matrix22 R;
    for (int r = 0; r < 2; ++r)
        for (int c = 0; c < 2; ++c) R.m[r][c] = V.m[r][0] * lambda[0] * V.m[c][0] + V.m[r][1] * lambda[1] * V.m[c][1];
    *root = R;
    return 1;
}

PLANO_API Plx_Bool bMatrix33GeneralRootInit(const Plx_Matrix33 *M, uint32_t levels, Matrix33GeneralRoot *root)
{
    if (!given(__func__, M, root)) return 0;
    root->no_levels = 0;
    root->root = root->power = nullptr;
    root->computed = nullptr;
    if (levels > kMaxLevels) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "too many levels", levels);
        return 0;
    }
    const std::size_t powers = (std::size_t{1} << levels) + 1;
    plx::HeapPtr<Plx_Matrix33> chain(PLX_ALLOC(Plx_Matrix33, levels + 1));
    if (chain == nullptr) return 0;
    plx::HeapPtr<Plx_Matrix33> power(PLX_ALLOC(Plx_Matrix33, powers));
    if (power == nullptr) return 0;
    plx::HeapPtr<uint8_t> computed(PLX_ALLOC(uint8_t, powers));
    if (computed == nullptr) return 0;
    chain.get()[levels] = *M;
    for (uint32_t k = levels; k-- > 0;)
        if (!bMatrix33SquareRoot(&chain.get()[k + 1], &chain.get()[k])) {
            PLX_ERR_PASS();
            return 0;
        }
    std::memset(computed.get(), 0, powers);
    plx_mat33_ident_s(&power.get()[0]);
    power.get()[powers - 1] = *M;
    computed.get()[0] = computed.get()[powers - 1] = 1;
    root->no_levels = levels;
    root->root = chain.release();
    root->power = power.release();
    root->computed = computed.release();
    return 1;
}

PLANO_API Plx_Bool bMatrix33GeneralRoot(Matrix33GeneralRoot *root, double t, Plx_Matrix33 *out)
{
    if (!given(__func__, root, out)) return 0;
    if (root->root == nullptr || root->power == nullptr || root->computed == nullptr) {
        PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "root not initialised", 0);
        return 0;
    }
    if (!(t >= 0.0) || !std::isfinite(t)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "exponent negative or not finite", 0);
        return 0;
    }
    if (t == 0.0) {
        plx_mat33_ident_s(out);
        return 1;
    }
    // M^t = (M^(t/2))^2 for t >= 1: halve into the table's range, then square back up.
    int squarings = 0;
    while (t >= 1.0) {
        t *= 0.5;
        ++squarings;
    }
    const uint32_t levels = root->no_levels;
    const uint32_t j = static_cast<uint32_t>(t * static_cast<double>(1u << levels) + 0.5);
    make_power(*root, j, 0);
    Plx_Matrix33 result = root->power[j];
    for (int i = 0; i < squarings; ++i) plx_mat33_rmultm33_s(&result, &result, &result);
    *out = result;
    return 1;
}

PLANO_API void vMatrix33GeneralRootFree(Matrix33GeneralRoot *root)
{
    if (root == nullptr) return;
    std::free(root->root);
    std::free(root->power);
    std::free(root->computed);
    root->root = root->power = nullptr;
    root->computed = nullptr;
    root->no_levels = 0;
}

}  // extern "C"
