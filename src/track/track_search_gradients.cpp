// Image derivatives of a search pixel image for the pixel-match Jacobians.
//
// The derivatives of the bilinear interpolant are differences of two neighbouring samples
// whose weights move with the sub-pixel phase; under noise in the search image their fixed
// point leans towards half-pixel positions, where interpolation averages the most noise
// away. Central differences, interpolated like the values, carry no such pull, which is
// what makes the tracker's estimate unbiased at the noise floor.
#include <cstdint>

#include "plano/track_homography.h"
#include "track/track_pixels_internal.hpp"

namespace {

using plano::track::bit_row;
using plano::track::test_bit;

// Half the difference of the two neighbours (a before, b after) when both are usable, the
// one-sided difference with the centre c when one is, else 0.
inline float difference(bool has_a, float a, float c, bool has_b, float b)
{
    if (has_a && has_b) return (b - a) * 0.5f;
    if (has_b) return b - c;
    if (has_a) return c - a;
    return 0.f;
}

// One row of both gradients; C floats per pixel. Without a mask every pixel counts as set.
void gradient_row(const Plx_Image *im, const Plx_Image *mask, int32_t r, uint32_t C, float *gx, float *gy)
{
    const int32_t w = im->width, h = im->height;
    const auto *row = static_cast<const float *>(plx_image_row(im, r));
    const auto *up = r > 0 ? static_cast<const float *>(plx_image_row(im, r - 1)) : nullptr;
    const auto *down = r + 1 < h ? static_cast<const float *>(plx_image_row(im, r + 1)) : nullptr;
    const uint32_t *m = mask ? bit_row(mask, r) : nullptr;
    const uint32_t *mu = mask && up ? bit_row(mask, r - 1) : nullptr;
    const uint32_t *md = mask && down ? bit_row(mask, r + 1) : nullptr;
    auto set = [mask](const uint32_t *bits, int32_t c) { return mask == nullptr || test_bit(bits, c); };
    for (int32_t c = 0; c < w; ++c) {
        const bool centre = set(m, c);
        const bool left = centre && c > 0 && set(m, c - 1);
        const bool right = centre && c + 1 < w && set(m, c + 1);
        const bool above = centre && up != nullptr && set(mu, c);
        const bool below = centre && down != nullptr && set(md, c);
        for (uint32_t k = 0; k < C; ++k) {
            const std::size_t i = std::size_t(c) * C + k;
            gx[i] = difference(left, left ? row[i - C] : 0.f, row[i], right, right ? row[i + C] : 0.f);
            gy[i] = difference(above, above ? up[i] : 0.f, row[i], below, below ? down[i] : 0.f);
        }
    }
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bTrackSearchGradients(const Plx_Image *image, const Plx_Image *mask, Plx_Image *gx,
                                         Plx_Image *gy)
{
    if (image == nullptr || gx == nullptr || gy == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (gx == gy || gx == image || gy == image) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the gradient images must be images of their own", 0);
        return PLX_FALSE;
    }
    const bool format_ok =
        image->format == PLX_FORMAT_GREY || image->format == PLX_FORMAT_RGB || image->format == PLX_FORMAT_RGBA;
    if (image->type != PLX_TYPE_FLOAT || !format_ok || image->data == nullptr || image->width < 1 ||
        image->height < 1) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "search image is not a float grey, RGB or RGBA image", image->format);
        return PLX_FALSE;
    }
    if (mask != nullptr && !plano::track::is_mask_of(mask, image->height, image->width)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "mask does not fit the image", 0);
        return PLX_FALSE;
    }
    if (!plx_image_set_gen(gx, image->format, PLX_TYPE_FLOAT, image->height, image->width) ||
        !plx_image_set_gen(gy, image->format, PLX_TYPE_FLOAT, image->height, image->width)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    const uint32_t C = plx_image_format_channels(image->format);
    for (int32_t r = 0; r < image->height; ++r)
        gradient_row(image, mask, r, C, static_cast<float *>(plx_image_row(gx, r)),
                     static_cast<float *>(plx_image_row(gy, r)));
    return PLX_TRUE;
}

}  // extern "C"
