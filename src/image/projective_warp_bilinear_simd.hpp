// Bilinear blending of 8-bit and one-channel float pixels, eight output pixels at a time with
// AVX2 where the machine has it. Both forms do the same single-precision operations in the
// same order (8-bit: on the raw levels, scaled by 1/255 last), so a warp gives the same bits
// on every machine.
#ifndef PLANO_SRC_IMAGE_PROJECTIVE_WARP_BILINEAR_SIMD_HPP
#define PLANO_SRC_IMAGE_PROJECTIVE_WARP_BILINEAR_SIMD_HPP

#include <cstddef>
#include <cstdint>

namespace plano::warp {

inline constexpr float kInv255 = 1.0f / 255.0f;

// One channel's blend from the four raw levels; w00 top-left, w10 top-right, w01 bottom-left.
inline float blend_u8(float w00, float w10, float w01, float w11, uint8_t a, uint8_t b, uint8_t c, uint8_t d)
{
    return ((w00 * float(a) + w10 * float(b)) + (w01 * float(c) + w11 * float(d))) * kInv255;
}

// Source layout of the vector kernels.
struct SourceBlock {
    const uint8_t *data;     // row 0 of the source (any pixel type)
    std::ptrdiff_t stride;   // bytes per row
    float last_x, last_y;    // width - 1, height - 1
};

// True when the machine runs the AVX2 kernels (asked once).
bool u8_bilinear_vector_available();

// Blends the eight pixels at positions px, py into out (C floats each) when all eight
// neighbourhoods lie inside the source and the kernel's reads stay on their rows (one channel:
// from column 2 on; three channels: before the last two columns); false, with out untouched,
// otherwise. Needs height * stride below 2^31.
bool u8_bilinear8_c1(const SourceBlock &b, const float *px, const float *py, float *out);
bool u8_bilinear8_c3(const SourceBlock &b, const float *px, const float *py, float *out);
bool u8_bilinear8_c4(const SourceBlock &b, const float *px, const float *py, float *out);
// The same for one-channel float sources (no scaling).
bool f32_bilinear8_c1(const SourceBlock &b, const float *px, const float *py, float *out);

// m floats to 8-bit levels exactly as store_value<uint8_t> converts them.
void store_u8_run(const float *v, uint8_t *out, std::size_t m);

}  // namespace plano::warp

#endif
