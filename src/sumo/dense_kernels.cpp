// Small dense kernels on raw row-major blocks: the optimiser's blocks are a few parameters
// wide, so plain loops without argument checks or temporaries are what the hot paths need.
#include <cmath>

#include "sumo/sumo_internal.hpp"

namespace sumo {

bool chol(double *a, uint32_t n)
{
    for (uint32_t j = 0; j < n; ++j) {
        double *rj = a + std::size_t(j) * n;
        double d = rj[j];
        for (uint32_t k = 0; k < j; ++k) d -= rj[k] * rj[k];
        if (!(d > 0.0) || !std::isfinite(d)) return false;
        d = std::sqrt(d);
        rj[j] = d;
        for (uint32_t i = j + 1; i < n; ++i) {
            double *ri = a + std::size_t(i) * n;
            double s = ri[j];
            for (uint32_t k = 0; k < j; ++k) s -= ri[k] * rj[k];
            ri[j] = s / d;
        }
        for (uint32_t k = j + 1; k < n; ++k) rj[k] = 0.0;
    }
    return true;
}

void fwd_v(const double *L, uint32_t n, double *b)
{
    for (uint32_t i = 0; i < n; ++i) {
        const double *ri = L + std::size_t(i) * n;
        double s = b[i];
        for (uint32_t k = 0; k < i; ++k) s -= ri[k] * b[k];
        b[i] = s / ri[i];
    }
}

void bwd_v(const double *L, uint32_t n, double *b)
{
    for (uint32_t i = n; i-- > 0;) {
        double s = b[i];
        for (uint32_t k = i + 1; k < n; ++k) s -= L[std::size_t(k) * n + i] * b[k];
        b[i] = s / L[std::size_t(i) * n + i];
    }
}

void fwd_m(const double *L, uint32_t n, double *B, uint32_t m)
{
    for (uint32_t i = 0; i < n; ++i) {
        const double *ri = L + std::size_t(i) * n;
        double *bi = B + std::size_t(i) * m;
        for (uint32_t k = 0; k < i; ++k) {
            const double l = ri[k];
            const double *bk = B + std::size_t(k) * m;
            for (uint32_t c = 0; c < m; ++c) bi[c] -= l * bk[c];
        }
        const double inv = 1.0 / ri[i];
        for (uint32_t c = 0; c < m; ++c) bi[c] *= inv;
    }
}

void bwd_m(const double *L, uint32_t n, double *B, uint32_t m)
{
    for (uint32_t i = n; i-- > 0;) {
        double *bi = B + std::size_t(i) * m;
        for (uint32_t k = i + 1; k < n; ++k) {
            const double l = L[std::size_t(k) * n + i];
            const double *bk = B + std::size_t(k) * m;
            for (uint32_t c = 0; c < m; ++c) bi[c] -= l * bk[c];
        }
        const double inv = 1.0 / L[std::size_t(i) * n + i];
        for (uint32_t c = 0; c < m; ++c) bi[c] *= inv;
    }
}

void chol_inverse(const double *L, uint32_t n, double *out)
{
    // Column by column: out e_j = L^-T L^-1 e_j.
    for (std::size_t i = 0; i < std::size_t(n) * n; ++i) out[i] = 0.0;
    for (uint32_t i = 0; i < n; ++i) out[std::size_t(i) * n + i] = 1.0;
    fwd_m(L, n, out, n);
    bwd_m(L, n, out, n);
    for (uint32_t i = 0; i < n; ++i)
        for (uint32_t j = 0; j < i; ++j) {
            const double v = 0.5 * (out[std::size_t(i) * n + j] + out[std::size_t(j) * n + i]);
            out[std::size_t(i) * n + j] = out[std::size_t(j) * n + i] = v;
        }
}

void add_atb(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, uint32_t m, double *C)
{
    for (uint32_t r = 0; r < k; ++r) {
        const double *ar = A + std::size_t(r) * n;
        const double *br = B + std::size_t(r) * m;
        for (uint32_t i = 0; i < n; ++i) {
            const double a = alpha * ar[i];
            if (a == 0.0) continue;
            double *ci = C + std::size_t(i) * m;
            for (uint32_t j = 0; j < m; ++j) ci[j] += a * br[j];
        }
    }
}

namespace {

// Largest block the dynamic kernels sum on the stack; larger ones add term by term.
constexpr uint32_t kLocal = 256;

template <uint32_t N, uint32_t M>
void atb_fixed(double alpha, const double *A, const double *B, uint32_t k, double *C)
{
    double t[N * M] = {};
    for (uint32_t r = 0; r < k; ++r) {
        const double *ar = A + std::size_t(r) * N;
        const double *br = B + std::size_t(r) * M;
        for (uint32_t i = 0; i < N; ++i) {
            const double a = ar[i];
            for (uint32_t j = 0; j < M; ++j) t[i * M + j] += a * br[j];
        }
    }
    for (uint32_t i = 0; i < N * M; ++i) C[i] += alpha * t[i];
}

void atb_dynamic(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, uint32_t m, double *C)
{
    if (n * m > kLocal) {
        add_atb(alpha, A, B, k, n, m, C);
        return;
    }
    double t[kLocal];
    std::memset(t, 0, sizeof(double) * n * m);
    for (uint32_t r = 0; r < k; ++r) {
        const double *ar = A + std::size_t(r) * n;
        const double *br = B + std::size_t(r) * m;
        for (uint32_t i = 0; i < n; ++i) {
            const double a = ar[i];
            for (uint32_t j = 0; j < m; ++j) t[i * m + j] += a * br[j];
        }
    }
    for (uint32_t i = 0; i < n * m; ++i) C[i] += alpha * t[i];
}

template <uint32_t N>
void atb_cols(double alpha, const double *A, const double *B, uint32_t k, uint32_t m, double *C)
{
    switch (m) {
    case 1: return atb_fixed<N, 1>(alpha, A, B, k, C);
    case 2: return atb_fixed<N, 2>(alpha, A, B, k, C);
    case 3: return atb_fixed<N, 3>(alpha, A, B, k, C);
    case 4: return atb_fixed<N, 4>(alpha, A, B, k, C);
    case 6: return atb_fixed<N, 6>(alpha, A, B, k, C);
    case 8: return atb_fixed<N, 8>(alpha, A, B, k, C);
    case 9: return atb_fixed<N, 9>(alpha, A, B, k, C);
    default: return atb_dynamic(alpha, A, B, k, N, m, C);
    }
}

// Lower triangle of A^T B summed locally, then added to both triangles of C.
template <uint32_t N>
void atb_sym_fixed(double alpha, const double *A, const double *B, uint32_t k, double *C)
{
    // The full square vectorises better than the triangle; only the lower half is used.
    double t[N * N] = {};
    for (uint32_t r = 0; r < k; ++r) {
        const double *ar = A + std::size_t(r) * N;
        const double *br = B + std::size_t(r) * N;
        for (uint32_t i = 0; i < N; ++i) {
            const double a = ar[i];
            for (uint32_t j = 0; j < N; ++j) t[i * N + j] += a * br[j];
        }
    }
    for (uint32_t i = 0; i < N; ++i) {
        for (uint32_t j = 0; j < i; ++j) {
            const double v = alpha * t[i * N + j];
            C[i * N + j] += v;
            C[j * N + i] += v;
        }
        C[i * N + i] += alpha * t[i * N + i];
    }
}

void atb_sym_dynamic(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, double *C)
{
    if (n * n > kLocal) {
        // Large blocks: each entry of the lower triangle summed on its own.
        for (uint32_t i = 0; i < n; ++i)
            for (uint32_t j = 0; j <= i; ++j) {
                double t = 0.0;
                for (uint32_t r = 0; r < k; ++r) t += A[std::size_t(r) * n + i] * B[std::size_t(r) * n + j];
                C[std::size_t(i) * n + j] += alpha * t;
                if (j < i) C[std::size_t(j) * n + i] += alpha * t;
            }
        return;
    }
    double t[kLocal];
    std::memset(t, 0, sizeof(double) * n * n);
    for (uint32_t r = 0; r < k; ++r) {
        const double *ar = A + std::size_t(r) * n;
        const double *br = B + std::size_t(r) * n;
        for (uint32_t i = 0; i < n; ++i) {
            const double a = ar[i];
            for (uint32_t j = 0; j <= i; ++j) t[i * n + j] += a * br[j];
        }
    }
    for (uint32_t i = 0; i < n; ++i) {
        for (uint32_t j = 0; j < i; ++j) {
            const double v = alpha * t[i * n + j];
            C[i * n + j] += v;
            C[j * n + i] += v;
        }
        C[i * n + i] += alpha * t[i * n + i];
    }
}

}  // namespace

void add_atb_block(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, uint32_t m, double *C)
{
    switch (n) {
    case 1: return atb_cols<1>(alpha, A, B, k, m, C);
    case 2: return atb_cols<2>(alpha, A, B, k, m, C);
    case 3: return atb_cols<3>(alpha, A, B, k, m, C);
    case 4: return atb_cols<4>(alpha, A, B, k, m, C);
    case 6: return atb_cols<6>(alpha, A, B, k, m, C);
    case 8: return atb_cols<8>(alpha, A, B, k, m, C);
    case 9: return atb_cols<9>(alpha, A, B, k, m, C);
    default: return atb_dynamic(alpha, A, B, k, n, m, C);
    }
}

void add_atb_sym(double alpha, const double *A, const double *B, uint32_t k, uint32_t n, double *C)
{
    switch (n) {
    case 1: return atb_sym_fixed<1>(alpha, A, B, k, C);
    case 2: return atb_sym_fixed<2>(alpha, A, B, k, C);
    case 3: return atb_sym_fixed<3>(alpha, A, B, k, C);
    case 4: return atb_sym_fixed<4>(alpha, A, B, k, C);
    case 6: return atb_sym_fixed<6>(alpha, A, B, k, C);
    case 8: return atb_sym_fixed<8>(alpha, A, B, k, C);
    case 9: return atb_sym_fixed<9>(alpha, A, B, k, C);
    default: return atb_sym_dynamic(alpha, A, B, k, n, C);
    }
}

void add_ab(double alpha, const double *A, const double *B, uint32_t n, uint32_t k, uint32_t m, double *C)
{
    for (uint32_t i = 0; i < n; ++i) {
        const double *ai = A + std::size_t(i) * k;
        double *ci = C + std::size_t(i) * m;
        for (uint32_t r = 0; r < k; ++r) {
            const double a = alpha * ai[r];
            const double *br = B + std::size_t(r) * m;
            for (uint32_t j = 0; j < m; ++j) ci[j] += a * br[j];
        }
    }
}

void add_abt(double alpha, const double *A, const double *B, uint32_t n, uint32_t k, uint32_t m, double *C)
{
    for (uint32_t i = 0; i < n; ++i) {
        const double *ai = A + std::size_t(i) * k;
        double *ci = C + std::size_t(i) * m;
        for (uint32_t j = 0; j < m; ++j) {
            const double *bj = B + std::size_t(j) * k;
            double s = 0.0;
            for (uint32_t r = 0; r < k; ++r) s += ai[r] * bj[r];
            ci[j] += alpha * s;
        }
    }
}

void add_av(double alpha, const double *A, const double *x, uint32_t n, uint32_t m, double *y)
{
    for (uint32_t i = 0; i < n; ++i) {
        const double *ai = A + std::size_t(i) * m;
        double s = 0.0;
        for (uint32_t j = 0; j < m; ++j) s += ai[j] * x[j];
        y[i] += alpha * s;
    }
}

void add_atv(double alpha, const double *A, const double *x, uint32_t n, uint32_t m, double *y)
{
    for (uint32_t i = 0; i < n; ++i) {
        const double a = alpha * x[i];
        const double *ai = A + std::size_t(i) * m;
        for (uint32_t j = 0; j < m; ++j) y[j] += a * ai[j];
    }
}

void add_llt_v(double alpha, const double *L, const double *x, uint32_t n, double *y)
{
    // y += alpha L (L^T x); blocks are small, so the inner product is recomputed per row
    // beyond the stack buffer rather than allocating.
    constexpr uint32_t kBuffer = 64;
    double t[kBuffer];
    auto ltx = [&](uint32_t i) {
        double s = 0.0;
        for (uint32_t k = i; k < n; ++k) s += L[std::size_t(k) * n + i] * x[k];
        return s;
    };
    for (uint32_t i = 0; i < n && i < kBuffer; ++i) t[i] = ltx(i);
    for (uint32_t i = 0; i < n; ++i) {
        double s = 0.0;
        for (uint32_t k = 0; k <= i; ++k) s += L[std::size_t(i) * n + k] * (k < kBuffer ? t[k] : ltx(k));
        y[i] += alpha * s;
    }
}

void squ_dense(const Plx_SquMatrix *A, double *out)
{
    const uint32_t n = A->size;
    switch (A->type) {
    case PLX_SQUMAT_DIAGONAL:
    case PLX_SQUMAT_SCALED_IDENTITY:
        for (std::size_t i = 0; i < std::size_t(n) * n; ++i) out[i] = 0.0;
        for (uint32_t i = 0; i < n; ++i)
            out[std::size_t(i) * n + i] = A->type == PLX_SQUMAT_DIAGONAL ? A->data[i] : A->data[0];
        break;
    case PLX_SQUMAT_SYMMETRIC:
        // The lower triangle is authoritative.
        for (uint32_t i = 0; i < n; ++i)
            for (uint32_t j = 0; j <= i; ++j)
                out[std::size_t(i) * n + j] = out[std::size_t(j) * n + i] = A->data[std::size_t(i) * n + j];
        break;
    default:
        std::memcpy(out, A->data, sizeof(double) * n * n);
        break;
    }
}

}  // namespace sumo
