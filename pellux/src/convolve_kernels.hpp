// The inner kernel of 1D convolution: out[i] = sum_t k[t] * src[t][i] over a flat run of values,
// compiled for the baseline instruction set and for AVX2, chosen once by CPU.
//
// Both builds do the same arithmetic in the same order, so a frame comes out bit for bit the
// same on every x86-64 machine (render farms mix CPUs):
//   - float and double accumulators: multiply, then add, never fused (no FMA is enabled for the
//     AVX2 build, and contraction is switched off on both wrappers whatever the build flags);
//   - 8-bit pixels under a Gaussian: 16-bit fixed point, exact integer arithmetic, on both.
// Header-only so tests can run each build side by side.
#ifndef PELLUX_SRC_CONVOLVE_KERNELS_HPP
#define PELLUX_SRC_CONVOLVE_KERNELS_HPP

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <type_traits>

#if defined(__x86_64__) || defined(__i386__)
#define PLX_CONV_X86 1
#include <immintrin.h>
#endif

// Keeps a function's products and sums unfused whatever the build flags. clang has no such
// per-function switch; it is given -ffp-contract=off for the whole build instead
// (cmake/PlanoWarnings.cmake).
#if defined(__clang__)
#define PLX_NO_FP_CONTRACT
#else
#define PLX_NO_FP_CONTRACT gnu::optimize("fp-contract=off")
#endif

namespace plx::conv {

enum class Isa { baseline, avx2 };

template <class A>
struct Lanes;
template <>
struct Lanes<float> {
    typedef float V __attribute__((vector_size(32)));
    static constexpr std::size_t W = 8;
};
template <>
struct Lanes<double> {
    typedef double V __attribute__((vector_size(32)));
    static constexpr std::size_t W = 4;
};
// 8-bit pixels under a symmetric mask of small positive taps (a Gaussian): values scaled by
// 128, taps by 2^17; each product keeps its high 16 bits (units of 1/256), the sums saturate,
// and a bias adds back the expected loss of the truncations. Sixteen values per step.
template <>
struct Lanes<uint16_t> {
    static constexpr std::size_t W = 16;
};

// ---- 16-bit fixed point ----

// The bias added once to every fixed-point sum: half a unit per truncated product pair.
inline uint16_t fixed_bias(uint32_t ntaps) { return uint16_t((ntaps / 2 + 1) / 2); }

// Exact model of one lane, also the kernel where no vector build exists.
inline void fixed_taps_scalar(uint16_t *out, const uint16_t *const *src, const uint16_t *k, uint32_t ntaps,
                              std::size_t n)
{
    const uint32_t r = ntaps / 2;
    auto adds = [](uint32_t a, uint32_t b) { return uint16_t(a + b > 65535u ? 65535u : a + b); };
    for (std::size_t i = 0; i < n; ++i) {
        uint16_t a = fixed_bias(ntaps);
        for (uint32_t t = 0; t < r; ++t) {
            const uint32_t s = uint16_t(src[t][i] + src[ntaps - 1 - t][i]);
            a = adds(a, (s * k[t]) >> 16);
        }
        a = adds(a, (uint32_t(src[r][i]) * k[r]) >> 16);
        out[i] = a;
    }
}

#ifdef PLX_CONV_X86
// n a multiple of 16.
inline void fixed_taps_sse2(uint16_t *out, const uint16_t *const *src, const uint16_t *k, uint32_t ntaps,
                            std::size_t n)
{
    const uint32_t r = ntaps / 2;
    const __m128i bias = _mm_set1_epi16(static_cast<short>(fixed_bias(ntaps)));
    for (std::size_t i = 0; i < n; i += 16) {
        __m128i a0 = bias, a1 = bias;
        for (uint32_t t = 0; t < r; ++t) {
            const __m128i kt = _mm_set1_epi16(static_cast<short>(k[t]));
            const __m128i *p = reinterpret_cast<const __m128i *>(src[t] + i);
            const __m128i *q = reinterpret_cast<const __m128i *>(src[ntaps - 1 - t] + i);
            a0 = _mm_adds_epu16(a0, _mm_mulhi_epu16(_mm_add_epi16(_mm_loadu_si128(p), _mm_loadu_si128(q)), kt));
            a1 = _mm_adds_epu16(a1, _mm_mulhi_epu16(_mm_add_epi16(_mm_loadu_si128(p + 1), _mm_loadu_si128(q + 1)), kt));
        }
        const __m128i kc = _mm_set1_epi16(static_cast<short>(k[r]));
        const __m128i *c = reinterpret_cast<const __m128i *>(src[r] + i);
        a0 = _mm_adds_epu16(a0, _mm_mulhi_epu16(_mm_loadu_si128(c), kc));
        a1 = _mm_adds_epu16(a1, _mm_mulhi_epu16(_mm_loadu_si128(c + 1), kc));
        _mm_storeu_si128(reinterpret_cast<__m128i *>(out + i), a0);
        _mm_storeu_si128(reinterpret_cast<__m128i *>(out + i + 8), a1);
    }
}

// n a multiple of 16; four registers of sixteen where the run allows.
[[gnu::target("avx2")]] inline void fixed_taps_avx2(uint16_t *out, const uint16_t *const *src, const uint16_t *k,
                                                    uint32_t ntaps, std::size_t n)
{
    const uint32_t r = ntaps / 2;
    const __m256i bias = _mm256_set1_epi16(static_cast<short>(fixed_bias(ntaps)));
    std::size_t i = 0;
    for (; i + 64 <= n; i += 64) {
        __m256i a0 = bias, a1 = bias, a2 = bias, a3 = bias;
        for (uint32_t t = 0; t < r; ++t) {
            const __m256i kt = _mm256_set1_epi16(static_cast<short>(k[t]));
            const __m256i *p = reinterpret_cast<const __m256i *>(src[t] + i);
            const __m256i *q = reinterpret_cast<const __m256i *>(src[ntaps - 1 - t] + i);
            a0 = _mm256_adds_epu16(a0, _mm256_mulhi_epu16(_mm256_add_epi16(_mm256_loadu_si256(p), _mm256_loadu_si256(q)), kt));
            a1 = _mm256_adds_epu16(a1, _mm256_mulhi_epu16(_mm256_add_epi16(_mm256_loadu_si256(p + 1), _mm256_loadu_si256(q + 1)), kt));
            a2 = _mm256_adds_epu16(a2, _mm256_mulhi_epu16(_mm256_add_epi16(_mm256_loadu_si256(p + 2), _mm256_loadu_si256(q + 2)), kt));
            a3 = _mm256_adds_epu16(a3, _mm256_mulhi_epu16(_mm256_add_epi16(_mm256_loadu_si256(p + 3), _mm256_loadu_si256(q + 3)), kt));
        }
        const __m256i kc = _mm256_set1_epi16(static_cast<short>(k[r]));
        const __m256i *c = reinterpret_cast<const __m256i *>(src[r] + i);
        a0 = _mm256_adds_epu16(a0, _mm256_mulhi_epu16(_mm256_loadu_si256(c), kc));
        a1 = _mm256_adds_epu16(a1, _mm256_mulhi_epu16(_mm256_loadu_si256(c + 1), kc));
        a2 = _mm256_adds_epu16(a2, _mm256_mulhi_epu16(_mm256_loadu_si256(c + 2), kc));
        a3 = _mm256_adds_epu16(a3, _mm256_mulhi_epu16(_mm256_loadu_si256(c + 3), kc));
        __m256i *o = reinterpret_cast<__m256i *>(out + i);
        _mm256_storeu_si256(o, a0);
        _mm256_storeu_si256(o + 1, a1);
        _mm256_storeu_si256(o + 2, a2);
        _mm256_storeu_si256(o + 3, a3);
    }
    for (; i + 16 <= n; i += 16) {
        __m256i a0 = bias;
        for (uint32_t t = 0; t < r; ++t) {
            const __m256i *p = reinterpret_cast<const __m256i *>(src[t] + i);
            const __m256i *q = reinterpret_cast<const __m256i *>(src[ntaps - 1 - t] + i);
            const __m256i s0 = _mm256_add_epi16(_mm256_loadu_si256(p), _mm256_loadu_si256(q));
            a0 = _mm256_adds_epu16(a0, _mm256_mulhi_epu16(s0, _mm256_set1_epi16(static_cast<short>(k[t]))));
        }
        const __m256i c0 = _mm256_loadu_si256(reinterpret_cast<const __m256i *>(src[r] + i));
        a0 = _mm256_adds_epu16(a0, _mm256_mulhi_epu16(c0, _mm256_set1_epi16(static_cast<short>(k[r]))));
        _mm256_storeu_si256(reinterpret_cast<__m256i *>(out + i), a0);
    }
}
#endif

// ---- float and double ----

// out[i] = sum_t k[t] * src[t][i] for i < n, n a multiple of the vector width. With Sym the
// mask is symmetric (k[t] == k[ntaps-1-t]) and mirrored taps are added before one multiply.
// Per lane the order is fixed: taps from the outside in, the centre last.
// Stream (float, AVX2 only): out is 32-byte aligned and written with non-temporal stores.
template <class A, bool Sym, bool Stream = false>
[[gnu::always_inline]] inline void float_taps(A *out, const A *const *src, const A *k, uint32_t ntaps,
                                              std::size_t n)
{
    using V = typename Lanes<A>::V;
    constexpr std::size_t W = Lanes<A>::W;
    const uint32_t r = ntaps / 2;
    std::size_t i = 0;
    for (; i + 4 * W <= n; i += 4 * W) {
        V a0 = {}, a1 = {}, a2 = {}, a3 = {};
        V x0, x1, x2, x3, y0, y1, y2, y3;
        if constexpr (Sym) {
            for (uint32_t t = 0; t < r; ++t) {
                const A *p = src[t] + i, *q = src[ntaps - 1 - t] + i;
                const A kt = k[t];
                std::memcpy(&x0, p, sizeof x0);
                std::memcpy(&x1, p + W, sizeof x1);
                std::memcpy(&x2, p + 2 * W, sizeof x2);
                std::memcpy(&x3, p + 3 * W, sizeof x3);
                std::memcpy(&y0, q, sizeof y0);
                std::memcpy(&y1, q + W, sizeof y1);
                std::memcpy(&y2, q + 2 * W, sizeof y2);
                std::memcpy(&y3, q + 3 * W, sizeof y3);
                a0 += kt * (x0 + y0);
                a1 += kt * (x1 + y1);
                a2 += kt * (x2 + y2);
                a3 += kt * (x3 + y3);
            }
        }
        for (uint32_t t = Sym ? r : 0; t < (Sym ? r + 1 : ntaps); ++t) {
            const A *p = src[t] + i;
            const A kt = k[t];
            std::memcpy(&x0, p, sizeof x0);
            std::memcpy(&x1, p + W, sizeof x1);
            std::memcpy(&x2, p + 2 * W, sizeof x2);
            std::memcpy(&x3, p + 3 * W, sizeof x3);
            a0 += kt * x0;
            a1 += kt * x1;
            a2 += kt * x2;
            a3 += kt * x3;
        }
        if constexpr (Stream) {
#if defined(__clang__)
            // clang has no GCC's store builtin but a generic one, which becomes vmovntps here.
            __builtin_nontemporal_store(a0, reinterpret_cast<V *>(out + i));
            __builtin_nontemporal_store(a1, reinterpret_cast<V *>(out + i + W));
            __builtin_nontemporal_store(a2, reinterpret_cast<V *>(out + i + 2 * W));
            __builtin_nontemporal_store(a3, reinterpret_cast<V *>(out + i + 3 * W));
#else
            __builtin_ia32_movntps256(reinterpret_cast<float *>(out + i), reinterpret_cast<__v8sf>(a0));
            __builtin_ia32_movntps256(reinterpret_cast<float *>(out + i + W), reinterpret_cast<__v8sf>(a1));
            __builtin_ia32_movntps256(reinterpret_cast<float *>(out + i + 2 * W), reinterpret_cast<__v8sf>(a2));
            __builtin_ia32_movntps256(reinterpret_cast<float *>(out + i + 3 * W), reinterpret_cast<__v8sf>(a3));
#endif
        } else {
        std::memcpy(out + i, &a0, sizeof a0);
        std::memcpy(out + i + W, &a1, sizeof a1);
        std::memcpy(out + i + 2 * W, &a2, sizeof a2);
        std::memcpy(out + i + 3 * W, &a3, sizeof a3);
        }
    }
    for (; i + W <= n; i += W) {
        V a0 = {}, x0, y0;
        if constexpr (Sym) {
            for (uint32_t t = 0; t < r; ++t) {
                std::memcpy(&x0, src[t] + i, sizeof x0);
                std::memcpy(&y0, src[ntaps - 1 - t] + i, sizeof y0);
                a0 += k[t] * (x0 + y0);
            }
        }
        for (uint32_t t = Sym ? r : 0; t < (Sym ? r + 1 : ntaps); ++t) {
            std::memcpy(&x0, src[t] + i, sizeof x0);
            a0 += k[t] * x0;
        }
        std::memcpy(out + i, &a0, sizeof a0);
    }
}

// ---- the two builds ----

// n a multiple of Lanes<A>::W. Fixed point (A = uint16_t) needs a symmetric mask.
template <class A, bool Sym>
[[PLX_NO_FP_CONTRACT]] void taps_baseline(A *out, const A *const *src, const A *k, uint32_t ntaps,
                                          std::size_t n)
{
    if constexpr (std::is_same_v<A, uint16_t>) {
#ifdef PLX_CONV_X86
        fixed_taps_sse2(out, src, k, ntaps, n);
#else
        fixed_taps_scalar(out, src, k, ntaps, n);
#endif
    } else {
        float_taps<A, Sym>(out, src, k, ntaps, n);
    }
}

#ifdef PLX_CONV_X86
// Stream: float results go straight to memory (non-temporal stores) when out is aligned, for
// outputs that are not read again soon; the values are the same.
template <class A, bool Sym, bool Stream = false>
[[gnu::target("avx2"), PLX_NO_FP_CONTRACT]] void taps_avx2(A *out, const A *const *src, const A *k,
                                                           uint32_t ntaps, std::size_t n)
{
    if constexpr (std::is_same_v<A, uint16_t>) {
        fixed_taps_avx2(out, src, k, ntaps, n);
    } else if constexpr (Stream && std::is_same_v<A, float>) {
        if ((reinterpret_cast<uintptr_t>(out) & 31) == 0)
            float_taps<A, Sym, true>(out, src, k, ntaps, n);
        else
            float_taps<A, Sym>(out, src, k, ntaps, n);
    } else {
        float_taps<A, Sym>(out, src, k, ntaps, n);
    }
}

inline bool cpu_has_avx2()
{
    static const bool has = __builtin_cpu_supports("avx2");
    return has;
}
#endif

// The build this machine runs.
inline Isa machine_isa()
{
#ifdef PLX_CONV_X86
    return cpu_has_avx2() ? Isa::avx2 : Isa::baseline;
#else
    return Isa::baseline;
#endif
}

template <class A, bool Sym>
inline void taps(Isa isa, A *out, const A *const *src, const A *k, uint32_t ntaps, std::size_t n)
{
#ifdef PLX_CONV_X86
    if (isa == Isa::avx2) {
        taps_avx2<A, Sym>(out, src, k, ntaps, n);
        return;
    }
#endif
    (void)isa;
    taps_baseline<A, Sym>(out, src, k, ntaps, n);
}

// The same with the instruction set fixed at compile time, for loops that choose it once.
template <class A, bool Sym, Isa I, bool Stream = false>
[[gnu::always_inline]] inline void taps_run(A *out, const A *const *src, const A *k, uint32_t ntaps, std::size_t n)
{
#ifdef PLX_CONV_X86
    if constexpr (I == Isa::avx2) {
        taps_avx2<A, Sym, Stream>(out, src, k, ntaps, n);
        return;
    }
#endif
    taps_baseline<A, Sym>(out, src, k, ntaps, n);
}

// taps_run over any n: whole vectors in place, the ragged tail staged through one full
// vector (zero-padded) so that every value gets the same arithmetic wherever it lies.
// stage holds ntaps + 1 vectors, stage_src ntaps pointers.
template <class A, bool Sym, Isa I, bool Stream = false>
[[gnu::always_inline]] inline void taps_any(A *out, const A *const *src, const A *k, uint32_t ntaps, std::size_t n,
                                            A *stage, const A **stage_src)
{
    constexpr std::size_t W = Lanes<A>::W;
    const std::size_t whole = n - n % W;
    if (whole != 0) taps_run<A, Sym, I, Stream>(out, src, k, ntaps, whole);
    if (whole == n) return;
    const std::size_t rest = n - whole;
    for (uint32_t t = 0; t < ntaps; ++t) {
        A *st = stage + std::size_t(t) * W;
        std::memcpy(st, src[t] + whole, rest * sizeof(A));
        for (std::size_t j = rest; j < W; ++j) st[j] = A(0);
        stage_src[t] = st;
    }
    A *tail = stage + std::size_t(ntaps) * W;
    taps_run<A, Sym, I>(tail, stage_src, k, ntaps, W);
    std::memcpy(out + whole, tail, rest * sizeof(A));
}

}  // namespace plx::conv

#endif
