// The fused pixel-match kernel: a block's chi-squared and normal-equation terms computed
// eight pixels at a time, with a portable lane pack and an AVX2 one that give the same bits
// (the same IEEE single-precision operations per lane, in the same order, and no fused
// multiply-add). The AVX2 pack runs when the machine has it.
#ifndef PLANO_SRC_TRACK_PIXEL_MATCH_LANES_HPP
#define PLANO_SRC_TRACK_PIXEL_MATCH_LANES_HPP

#include <immintrin.h>

#include <algorithm>
#include <climits>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <type_traits>

#include "pellux/image.h"

namespace plano::pixel_match {

enum class Warp { affine, proj, translate, trans_rot_scale, trans_scale };

template <Warp W>
constexpr uint32_t warp_params()
{
    switch (W) {
    case Warp::affine: return 6;
    case Warp::proj: return 9;
    case Warp::translate: return 2;
    case Warp::trans_rot_scale: return 4;
    case Warp::trans_scale: return 3;
    }
    return 0;
}

inline bool bit_at(const Plx_Image *mask, int32_t r, int32_t c)
{
    const auto *row = static_cast<const uint32_t *>(plx_image_row(mask, r));
    return (row[c >> 5] >> (c & 31)) & 1u;
}

// One block's inputs to the lane kernel.
struct BlockArgs {
    float p[9];
    float gain, offset, zh;
    const float *data;   // search row 0
    const float *grad_x, *grad_y;  // gradient rows 0 at the search image's stride, or null
    int32_t stride;      // floats per search row
    int32_t step;        // floats per search pixel
    float wlim, hlim;    // width - 1, height - 1
    const Plx_Image *mask;
    const float *positions;
    uint32_t no_pixels;
    const double *z;
    const double *info;
    uint32_t info_step;
    bool terms;          // false: chi-squared only
};

// Per-lane sums of one block: the lower triangle of sum w j j^T (row by row), sum w j r and
// sum w r^2.
template <uint32_t P>
struct Lanes {
    alignas(32) float a[P * (P + 1) / 2][8];
    alignas(32) float g[P][8];
    alignas(32) double chi[8];
};

// The lanes (bits of `lanes`) whose four footprint pixels are all set in the mask. The search
// mask is mostly full, so the box around the lanes is tried first.
inline uint32_t footprint_lanes(const Plx_Image *mask, const int32_t *cx, const int32_t *cy, uint32_t lanes)
{
    int32_t x0 = INT32_MAX, x1 = INT32_MIN, y0 = INT32_MAX, y1 = INT32_MIN;
    for (uint32_t l = 0; l < 8; ++l)
        if (lanes >> l & 1u) {
            x0 = std::min(x0, cx[l]), x1 = std::max(x1, cx[l] + 1);
            y0 = std::min(y0, cy[l]), y1 = std::max(y1, cy[l] + 1);
        }
    bool full = true;
    for (int32_t r = y0; full && r <= y1; ++r) {
        const auto *row = static_cast<const uint32_t *>(plx_image_row(mask, r));
        for (int32_t w = x0 >> 5; full && w <= x1 >> 5; ++w) {
            const uint32_t lo = w == x0 >> 5 ? uint32_t(x0 & 31) : 0u, hi = w == x1 >> 5 ? uint32_t(x1 & 31) : 31u;
            const uint32_t want = (hi == 31 ? ~0u : (2u << hi) - 1u) & ~((1u << lo) - 1u);
            full = (row[w] & want) == want;
        }
    }
    if (full) return lanes;
    uint32_t kept = 0;
    for (uint32_t l = 0; l < 8; ++l)
        if ((lanes >> l & 1u) && bit_at(mask, cy[l], cx[l]) && bit_at(mask, cy[l], cx[l] + 1) &&
            bit_at(mask, cy[l] + 1, cx[l]) && bit_at(mask, cy[l] + 1, cx[l] + 1))
            kept |= 1u << l;
    return kept;
}

namespace portable {

// Eight lanes as two halves of GCC's 16-byte vector types: the compiler maps them onto what
// the target offers (SSE2 at least), with the same element-wise IEEE operations.
struct V {
    typedef float F4 __attribute__((vector_size(16)));
    typedef int32_t I4 __attribute__((vector_size(16)));
    struct F {
        F4 h[2];
        float operator[](int l) const { return h[l >> 2][l & 3]; }
    };
    struct I {
        I4 h[2];
        int32_t operator[](int l) const { return h[l >> 2][l & 3]; }
    };
    using M = I;  // -1 in the lanes where true

    static F splat(float x) { return F{{F4{x, x, x, x}, F4{x, x, x, x}}}; }
    static F load(const float *p)
    {
        F r{};
        std::memcpy(&r, p, sizeof r);
        return r;
    }
    static void store(float *p, F a) { std::memcpy(p, &a, sizeof a); }
    static I load_i(const int32_t *p)
    {
        I r;
        std::memcpy(&r, p, sizeof r);
        return r;
    }
    static F add(F a, F b) { return F{{a.h[0] + b.h[0], a.h[1] + b.h[1]}}; }
    static F sub(F a, F b) { return F{{a.h[0] - b.h[0], a.h[1] - b.h[1]}}; }
    static F mul(F a, F b) { return F{{a.h[0] * b.h[0], a.h[1] * b.h[1]}}; }
    static F div(F a, F b) { return F{{a.h[0] / b.h[0], a.h[1] / b.h[1]}}; }
    static F neg(F a) { return F{{-a.h[0], -a.h[1]}}; }
    static M ge(F a, F b) { return M{{a.h[0] >= b.h[0], a.h[1] >= b.h[1]}}; }
    static M lt(F a, F b) { return M{{a.h[0] < b.h[0], a.h[1] < b.h[1]}}; }
    static M ne(F a, F b) { return M{{a.h[0] != b.h[0], a.h[1] != b.h[1]}}; }
    static M all() { return M{{I4{-1, -1, -1, -1}, I4{-1, -1, -1, -1}}}; }
    static M both(M a, M b) { return M{{a.h[0] & b.h[0], a.h[1] & b.h[1]}}; }
    static uint32_t bits(M m)
    {
        uint32_t b = 0;
        for (int l = 0; l < 8; ++l) b |= m[l] != 0 ? 1u << l : 0u;
        return b;
    }
    static M from_bits(uint32_t b)
    {
        int32_t m[8];
        for (int l = 0; l < 8; ++l) m[l] = (b >> l & 1u) ? -1 : 0;
        return load_i(m);
    }
    static F keep(M m, F a) { return F{{F4(I4(a.h[0]) & m.h[0]), F4(I4(a.h[1]) & m.h[1])}}; }
    static I keep_i(M m, I a) { return I{{a.h[0] & m.h[0], a.h[1] & m.h[1]}}; }
    // Truncation toward zero; values outside int range only occur in lanes kept out later
    // (INT32_MIN, as the AVX2 conversion gives).
    static I trunc(F a)
    {
        int32_t r[8];
        for (int l = 0; l < 8; ++l) r[l] = a[l] >= -2147483648.f && a[l] < 2147483648.f ? int32_t(a[l]) : INT32_MIN;
        return load_i(r);
    }
    static F to_float(I a) { return F{{__builtin_convertvector(a.h[0], F4), __builtin_convertvector(a.h[1], F4)}}; }
    static void store_i(int32_t *p, I a) { std::memcpy(p, &a, sizeof a); }
    static I index(I y, int32_t stride, I x, int32_t step)
    {
        return I{{y.h[0] * stride + x.h[0] * step, y.h[1] * stride + x.h[1] * step}};
    }
    static F gather(const float *base, I at)
    {
        float r[8];
        for (int l = 0; l < 8; ++l) r[l] = base[at[l]];
        return load(r);
    }
    // a = base[at], b = base[at + 1].
    static void gather_pair(const float *base, I at, F &a, F &b)
    {
        float ra[8], rb[8];
        for (int l = 0; l < 8; ++l) ra[l] = base[at[l]], rb[l] = base[at[l] + 1];
        a = load(ra), b = load(rb);
    }
    static void deinterleave(const float *xy, F &x, F &y)
    {
        float rx[8], ry[8];
        for (int l = 0; l < 8; ++l) rx[l] = xy[2 * l], ry[l] = xy[2 * l + 1];
        x = load(rx), y = load(ry);
    }
    static F load_d(const double *p)
    {
        float r[8];
        for (int l = 0; l < 8; ++l) r[l] = float(p[l]);
        return load(r);
    }
    template <bool set>
    static void acc_chi(double *sum, F wr, F r)
    {
        for (int l = 0; l < 8; ++l) {
            const double t = double(wr[l]) * double(r[l]);
            sum[l] = set ? t : sum[l] + t;
        }
    }
    // The lane sums, each as the fixed tree ((0 + 4) + (1 + 5)) + ((2 + 6) + (3 + 7)), times s.
    static double reduce_chi(const double *v) { return ((v[0] + v[4]) + (v[1] + v[5])) + ((v[2] + v[6]) + (v[3] + v[7])); }
    static void reduce(const float (*v)[8], uint32_t count, double s, double *out)
    {
        for (uint32_t e = 0; e < count; ++e) {
            double d[8];
            for (int l = 0; l < 8; ++l) d[l] = double(v[e][l]);
            out[e] = s * reduce_chi(d);
        }
    }
};

#include "track/pixel_match_block.inc"

}  // namespace portable

// Everything of the AVX2 pack is compiled for AVX2; each compiler has its own spelling.
#if defined(__clang__)
#pragma clang attribute push(__attribute__((target("avx2"))), apply_to = function)
#else
#pragma GCC push_options
#pragma GCC target("avx2")
#endif
namespace avx2 {

// Eight lanes in AVX2 registers: the same operations as the portable pack (no fused
// multiply-add, which would round differently).
struct V {
    using F = __m256;
    using I = __m256i;
    using M = __m256;

    static F splat(float x) { return _mm256_set1_ps(x); }
    static F load(const float *p) { return _mm256_load_ps(p); }
    static void store(float *p, F a) { _mm256_store_ps(p, a); }
    static F add(F a, F b) { return _mm256_add_ps(a, b); }
    static F sub(F a, F b) { return _mm256_sub_ps(a, b); }
    static F mul(F a, F b) { return _mm256_mul_ps(a, b); }
    static F div(F a, F b) { return _mm256_div_ps(a, b); }
    static F neg(F a) { return _mm256_xor_ps(a, _mm256_set1_ps(-0.f)); }
    static M ge(F a, F b) { return _mm256_cmp_ps(a, b, _CMP_GE_OQ); }
    static M lt(F a, F b) { return _mm256_cmp_ps(a, b, _CMP_LT_OQ); }
    // Unordered not-equal, as the scalar != (NaN compares unequal).
    static M ne(F a, F b) { return _mm256_cmp_ps(a, b, _CMP_NEQ_UQ); }
    static M all() { return _mm256_castsi256_ps(_mm256_set1_epi32(-1)); }
    static M both(M a, M b) { return _mm256_and_ps(a, b); }
    static uint32_t bits(M m) { return uint32_t(_mm256_movemask_ps(m)); }
    static M from_bits(uint32_t b)
    {
        const __m256i lane = _mm256_setr_epi32(1, 2, 4, 8, 16, 32, 64, 128);
        const __m256i set = _mm256_and_si256(_mm256_set1_epi32(int32_t(b)), lane);
        return _mm256_castsi256_ps(_mm256_cmpeq_epi32(set, lane));
    }
    static F keep(M m, F a) { return _mm256_and_ps(m, a); }
    static I keep_i(M m, I a) { return _mm256_and_si256(_mm256_castps_si256(m), a); }
    // cvtt gives INT32_MIN for out-of-range values and NaN, as the portable pack.
    static I trunc(F a) { return _mm256_cvttps_epi32(a); }
    static F to_float(I a) { return _mm256_cvtepi32_ps(a); }
    static void store_i(int32_t *p, I a) { _mm256_store_si256(reinterpret_cast<__m256i *>(p), a); }
    static I index(I y, int32_t stride, I x, int32_t step)
    {
        return _mm256_add_epi32(_mm256_mullo_epi32(y, _mm256_set1_epi32(stride)),
                                _mm256_mullo_epi32(x, _mm256_set1_epi32(step)));
    }
    static F gather(const float *base, I at) { return _mm256_i32gather_ps(base, at, 4); }
    // a = base[at], b = base[at + 1]: each pair read as one 64-bit element (half the
    // elements of two single gathers).
    static void gather_pair(const float *base, I at, F &a, F &b)
    {
        // The masked form: the plain one starts from an undefined register, which GCC 12
        // reports as uninitialised.
        const auto *p = reinterpret_cast<const double *>(base);
        const __m256d all = _mm256_castsi256_pd(_mm256_set1_epi64x(-1));
        const __m256 lo = _mm256_castpd_ps(
            _mm256_mask_i32gather_pd(_mm256_setzero_pd(), p, _mm256_castsi256_si128(at), all, 4));
        const __m256 hi = _mm256_castpd_ps(
            _mm256_mask_i32gather_pd(_mm256_setzero_pd(), p, _mm256_extracti128_si256(at, 1), all, 4));
        // lo = a0 b0 a1 b1 | a2 b2 a3 b3, hi = a4 b4 a5 b5 | a6 b6 a7 b7
        const __m256i order = _mm256_setr_epi32(0, 1, 4, 5, 2, 3, 6, 7);
        a = _mm256_permutevar8x32_ps(_mm256_shuffle_ps(lo, hi, _MM_SHUFFLE(2, 0, 2, 0)), order);
        b = _mm256_permutevar8x32_ps(_mm256_shuffle_ps(lo, hi, _MM_SHUFFLE(3, 1, 3, 1)), order);
    }
    static void deinterleave(const float *xy, F &x, F &y)
    {
        const __m256 a = _mm256_loadu_ps(xy), b = _mm256_loadu_ps(xy + 8);
        // a = x0 y0 x1 y1 | x2 y2 x3 y3, b = x4 y4 x5 y5 | x6 y6 x7 y7
        const __m256 xs = _mm256_shuffle_ps(a, b, _MM_SHUFFLE(2, 0, 2, 0));  // x0 x1 x4 x5 | x2 x3 x6 x7
        const __m256 ys = _mm256_shuffle_ps(a, b, _MM_SHUFFLE(3, 1, 3, 1));
        const __m256i order = _mm256_setr_epi32(0, 1, 4, 5, 2, 3, 6, 7);
        x = _mm256_permutevar8x32_ps(xs, order);
        y = _mm256_permutevar8x32_ps(ys, order);
    }
    static F load_d(const double *p)
    {
        return _mm256_set_m128(_mm256_cvtpd_ps(_mm256_loadu_pd(p + 4)), _mm256_cvtpd_ps(_mm256_loadu_pd(p)));
    }
    template <bool set>
    static void acc_chi(double *sum, F wr, F r)
    {
        const __m256d w0 = _mm256_cvtps_pd(_mm256_castps256_ps128(wr)), w1 = _mm256_cvtps_pd(_mm256_extractf128_ps(wr, 1));
        const __m256d r0 = _mm256_cvtps_pd(_mm256_castps256_ps128(r)), r1 = _mm256_cvtps_pd(_mm256_extractf128_ps(r, 1));
        const __m256d t0 = _mm256_mul_pd(w0, r0), t1 = _mm256_mul_pd(w1, r1);
        _mm256_store_pd(sum, set ? t0 : _mm256_add_pd(_mm256_load_pd(sum), t0));
        _mm256_store_pd(sum + 4, set ? t1 : _mm256_add_pd(_mm256_load_pd(sum + 4), t1));
    }
    // Four sums at once: for entry e the lane pairs p_e = (0 + 4, 1 + 5, 2 + 6, 3 + 7), then
    // (p0 + p1) + (p2 + p3), as the portable tree.
    static __m256d pairs(const float *v)
    {
        const __m256 x = _mm256_load_ps(v);
        return _mm256_add_pd(_mm256_cvtps_pd(_mm256_castps256_ps128(x)), _mm256_cvtps_pd(_mm256_extractf128_ps(x, 1)));
    }
    static __m256d tree4(__m256d p0, __m256d p1, __m256d p2, __m256d p3)
    {
        const __m256d h01 = _mm256_hadd_pd(p0, p1), h23 = _mm256_hadd_pd(p2, p3);
        return _mm256_add_pd(_mm256_permute2f128_pd(h01, h23, 0x20), _mm256_permute2f128_pd(h01, h23, 0x31));
    }
    static double reduce_chi(const double *v)
    {
        const __m256d p = _mm256_add_pd(_mm256_load_pd(v), _mm256_load_pd(v + 4));
        return _mm256_cvtsd_f64(tree4(p, p, p, p));
    }
    static void reduce(const float (*v)[8], uint32_t count, double s, double *out)
    {
        const __m256d scale = _mm256_set1_pd(s);
        uint32_t e = 0;
        for (; e + 4 <= count; e += 4)
            _mm256_storeu_pd(out + e, _mm256_mul_pd(scale, tree4(pairs(v[e]), pairs(v[e + 1]), pairs(v[e + 2]), pairs(v[e + 3]))));
        for (; e < count; ++e) {
            const __m256d p = pairs(v[e]);
            out[e] = s * _mm256_cvtsd_f64(tree4(p, p, p, p));
        }
    }
};

#include "track/pixel_match_block.inc"

}  // namespace avx2
#if defined(__clang__)
#pragma clang attribute pop
#else
#pragma GCC pop_options
#endif

inline bool avx2_available()
{
    static const bool available = __builtin_cpu_supports("avx2");
    return available;
}

}  // namespace plano::pixel_match

#endif
