// AVX2 kernels of the 8-bit bilinear blend: positions, weights and the four neighbours of
// eight pixels at once, the neighbours fetched with 32-bit gathers that never read past the
// pixels a neighbourhood covers.
#include "image/projective_warp_bilinear_simd.hpp"
#include "image/projective_warp_pixels.hpp"

#include <immintrin.h>

#include <cstdint>
#include <cstring>

namespace plano::warp {

bool u8_bilinear_vector_available()
{
    static const bool available = __builtin_cpu_supports("avx2");
    return available;
}

namespace {

struct Neighbourhood {
    __m256 w00, w10, w01, w11;
    __m256i o0, o1;  // byte offsets of the top-left pixel in row iy and row iy + 1
};

// False when any of the eight neighbourhoods is not wholly inside (min_x: least column).
[[gnu::target("avx2")]] inline bool neighbourhood(const SourceBlock &b, const float *px, const float *py, int pixel_bytes,
                                                  float min_x, float max_x, Neighbourhood &n)
{
    const __m256 x = _mm256_loadu_ps(px), y = _mm256_loadu_ps(py);
    const __m256 inside = _mm256_and_ps(
        _mm256_and_ps(_mm256_cmp_ps(x, _mm256_set1_ps(min_x), _CMP_GE_OQ),
                      _mm256_cmp_ps(x, _mm256_set1_ps(max_x), _CMP_LT_OQ)),
        _mm256_and_ps(_mm256_cmp_ps(y, _mm256_setzero_ps(), _CMP_GE_OQ),
                      _mm256_cmp_ps(y, _mm256_set1_ps(b.last_y), _CMP_LT_OQ)));
    if (_mm256_movemask_ps(inside) != 0xFF) return false;
    const __m256i ix = _mm256_cvttps_epi32(x), iy = _mm256_cvttps_epi32(y);
    const __m256 one = _mm256_set1_ps(1.0f);
    const __m256 fx = _mm256_sub_ps(x, _mm256_cvtepi32_ps(ix)), fy = _mm256_sub_ps(y, _mm256_cvtepi32_ps(iy));
    const __m256 gx = _mm256_sub_ps(one, fx), gy = _mm256_sub_ps(one, fy);
    n.w00 = _mm256_mul_ps(gx, gy);
    n.w10 = _mm256_mul_ps(fx, gy);
    n.w01 = _mm256_mul_ps(gx, fy);
    n.w11 = _mm256_mul_ps(fx, fy);
    const __m256i stride = _mm256_set1_epi32(int32_t(b.stride));
    n.o0 = _mm256_add_epi32(_mm256_mullo_epi32(iy, stride), _mm256_mullo_epi32(ix, _mm256_set1_epi32(pixel_bytes)));
    n.o1 = _mm256_add_epi32(n.o0, stride);
    return true;
}

[[gnu::target("avx2")]] inline __m256 byte_of(__m256i v, int k)
{
    return _mm256_cvtepi32_ps(_mm256_and_si256(_mm256_srl_epi32(v, _mm_cvtsi32_si128(8 * k)), _mm256_set1_epi32(0xFF)));
}

[[gnu::target("avx2")]] inline __m256 blend(const Neighbourhood &n, __m256 a, __m256 b, __m256 c, __m256 d)
{
    const __m256 top = _mm256_add_ps(_mm256_mul_ps(n.w00, a), _mm256_mul_ps(n.w10, b));
    const __m256 bottom = _mm256_add_ps(_mm256_mul_ps(n.w01, c), _mm256_mul_ps(n.w11, d));
    return _mm256_mul_ps(_mm256_add_ps(top, bottom), _mm256_set1_ps(kInv255));
}

template <int C>
[[gnu::target("avx2")]] inline void interleave(const __m256 (&v)[C], float *out)
{
    alignas(32) float lane[C][8];
    for (int c = 0; c < C; ++c) _mm256_store_ps(lane[c], v[c]);
    for (int k = 0; k < 8; ++k)
        for (int c = 0; c < C; ++c) out[k * C + c] = lane[c][k];
}

// The first Bytes (at most four) bytes at each of eight offsets, one pixel per dword.
template <int Bytes>
[[gnu::target("avx2")]] inline __m256i load_dwords(const uint8_t *data, __m256i offsets)
{
    alignas(32) int32_t o[8];
    _mm256_store_si256(reinterpret_cast<__m256i *>(o), offsets);
    int32_t v[8] = {};
    for (int k = 0; k < 8; ++k) std::memcpy(&v[k], data + o[k], Bytes);
    return _mm256_setr_epi32(v[0], v[1], v[2], v[3], v[4], v[5], v[6], v[7]);
}

}  // namespace

[[gnu::target("avx2")]] bool u8_bilinear8_c1(const SourceBlock &b, const float *px, const float *py, float *out)
{
    Neighbourhood n;
    if (!neighbourhood(b, px, py, 1, 0.0f, b.last_x, n)) return false;
    const __m256i r0 = load_dwords<2>(b.data, n.o0), r1 = load_dwords<2>(b.data, n.o1);
    _mm256_storeu_ps(out, blend(n, byte_of(r0, 0), byte_of(r0, 1), byte_of(r1, 0), byte_of(r1, 1)));
    return true;
}

namespace {

// Eight bytes from each of eight offsets: (low four bytes, high four bytes) per pixel. Plain
// loads beat the gather instructions on the machines we run on (AMD Zen: about 1.7x).
[[gnu::target("avx2")]] inline void gather8x8(const uint8_t *data, __m256i offsets, __m256i &lo, __m256i &hi)
{
    alignas(32) int32_t o[8];
    _mm256_store_si256(reinterpret_cast<__m256i *>(o), offsets);
    long long v[8];
    for (int k = 0; k < 8; ++k) std::memcpy(&v[k], data + o[k], 8);
    const __m256i g0 = _mm256_setr_epi64x(v[0], v[1], v[2], v[3]);
    const __m256i g1 = _mm256_setr_epi64x(v[4], v[5], v[6], v[7]);
    // Dwords (0, 2) of each 128-bit half are low halves, (1, 3) high: pack, then restore order.
    const __m256 a = _mm256_castsi256_ps(g0), b = _mm256_castsi256_ps(g1);
    const __m256i order = _mm256_setr_epi32(0, 1, 4, 5, 2, 3, 6, 7);
    lo = _mm256_permutevar8x32_epi32(_mm256_castps_si256(_mm256_shuffle_ps(a, b, _MM_SHUFFLE(2, 0, 2, 0))), order);
    hi = _mm256_permutevar8x32_epi32(_mm256_castps_si256(_mm256_shuffle_ps(a, b, _MM_SHUFFLE(3, 1, 3, 1))), order);
}

}  // namespace

[[gnu::target("avx2")]] bool u8_bilinear8_c3(const SourceBlock &b, const float *px, const float *py, float *out)
{
    // Eight bytes from the top-left pixel hold both pixels of a row (R G B R' G' B' + 2), so
    // the last two columns, whose eight bytes would leave the row, go pixel by pixel.
    Neighbourhood n;
    if (!neighbourhood(b, px, py, 3, 0.0f, b.last_x - 1.0f, n)) return false;
    __m256i l0, h0, l1, h1;
    gather8x8(b.data, n.o0, l0, h0);
    gather8x8(b.data, n.o1, l1, h1);
    const __m256 v[3] = {
        blend(n, byte_of(l0, 0), byte_of(l0, 3), byte_of(l1, 0), byte_of(l1, 3)),
        blend(n, byte_of(l0, 1), byte_of(h0, 0), byte_of(l1, 1), byte_of(h1, 0)),
        blend(n, byte_of(l0, 2), byte_of(h0, 1), byte_of(l1, 2), byte_of(h1, 1)),
    };
    interleave<3>(v, out);
    return true;
}

[[gnu::target("avx2")]] bool u8_bilinear8_c4(const SourceBlock &b, const float *px, const float *py, float *out)
{
    Neighbourhood n;
    if (!neighbourhood(b, px, py, 4, 0.0f, b.last_x, n)) return false;
    // Eight bytes from the top-left pixel are the row's two pixels.
    __m256i l0, h0, l1, h1;
    gather8x8(b.data, n.o0, l0, h0);
    gather8x8(b.data, n.o1, l1, h1);
    __m256 v[4];
    for (int c = 0; c < 4; ++c) v[c] = blend(n, byte_of(l0, c), byte_of(h0, c), byte_of(l1, c), byte_of(h1, c));
    interleave<4>(v, out);
    return true;
}

[[gnu::target("avx2")]] bool f32_bilinear8_c1(const SourceBlock &b, const float *px, const float *py, float *out)
{
    Neighbourhood n;
    if (!neighbourhood(b, px, py, 4, 0.0f, b.last_x, n)) return false;
    // Eight bytes from the top-left pixel are the row's two floats.
    __m256i l0, h0, l1, h1;
    gather8x8(b.data, n.o0, l0, h0);
    gather8x8(b.data, n.o1, l1, h1);
    const __m256 top = _mm256_add_ps(_mm256_mul_ps(n.w00, _mm256_castsi256_ps(l0)),
                                     _mm256_mul_ps(n.w10, _mm256_castsi256_ps(h0)));
    const __m256 bottom = _mm256_add_ps(_mm256_mul_ps(n.w01, _mm256_castsi256_ps(l1)),
                                        _mm256_mul_ps(n.w11, _mm256_castsi256_ps(h1)));
    _mm256_storeu_ps(out, _mm256_add_ps(top, bottom));
    return true;
}

namespace {

[[gnu::target("avx2")]] void store_u8_avx2(const float *v, uint8_t *out, std::size_t m)
{
    const __m256 scale = _mm256_set1_ps(255.0f), half = _mm256_set1_ps(0.5f), zero = _mm256_setzero_ps();
    std::size_t k = 0;
    for (; k + 16 <= m; k += 16) {
        __m256i q[2];
        for (int j = 0; j < 2; ++j) {
            __m256 s = _mm256_add_ps(_mm256_mul_ps(_mm256_loadu_ps(v + k + 8 * j), scale), half);
            s = _mm256_max_ps(s, zero);   // NaN gives the second operand: 0
            s = _mm256_min_ps(s, scale);
            q[j] = _mm256_cvttps_epi32(s);
        }
        // 16 words in lane order (0-3, 8-11 | 4-7, 12-15), then bytes; restore the order.
        const __m256i words = _mm256_permute4x64_epi64(_mm256_packus_epi32(q[0], q[1]), _MM_SHUFFLE(3, 1, 2, 0));
        const __m128i bytes = _mm_packus_epi16(_mm256_castsi256_si128(words), _mm256_extracti128_si256(words, 1));
        _mm_storeu_si128(reinterpret_cast<__m128i *>(out + k), bytes);
    }
    for (; k < m; ++k) out[k] = store_value<uint8_t>(v[k]);
}

}  // namespace

void store_u8_run(const float *v, uint8_t *out, std::size_t m)
{
    if (u8_bilinear_vector_available()) {
        store_u8_avx2(v, out, m);
        return;
    }
    for (std::size_t k = 0; k < m; ++k) out[k] = store_value<uint8_t>(v[k]);
}

}  // namespace plano::warp
