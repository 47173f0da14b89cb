// Region masks: peeling a mask where two images agree, and cutting a masked window.
#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "plano/track_pixels.h"
#include "track/track_pixels_internal.hpp"

namespace {

using namespace plano::track;

// Word i of a mask row as the boundary test sees it: bits past the width, and words before
// or after the row, count as set (outside the image is never a reason to peel).
inline uint32_t word_outside_set(const uint32_t *row, int32_t i, int32_t words, uint32_t tail)
{
    if (i < 0 || i >= words) return ~0u;
    return i == words - 1 ? (row[i] | ~tail) : row[i];
}

// Bits of row word i whose 8 neighbours (inside the image) are all set in the three rows.
uint32_t all_neighbours_set(const uint32_t *up, const uint32_t *mid, const uint32_t *down, int32_t i,
                            int32_t words, uint32_t tail)
{
    uint32_t acc = ~0u;
    for (const uint32_t *row : {up, mid, down}) {
        if (row == nullptr) continue;  // a row outside the image
        const uint32_t w = word_outside_set(row, i, words, tail);
        const uint32_t left = (w << 1) | (word_outside_set(row, i - 1, words, tail) >> 31);
        const uint32_t right = (w >> 1) | (word_outside_set(row, i + 1, words, tail) << 31);
        acc &= left & right;
        if (row != mid) acc &= w;
    }
    return acc;
}

// One peeling pass: clears in w the boundary pixels of r where a and b agree. True when a
// pixel was cleared.
bool peel_pass(const Plx_Image *a, const Plx_Image *b, const Plx_Image *r, Plx_Image *w, int32_t threshold)
{
    const int32_t height = r->height, width = r->width, words = words_of(width);
    const uint32_t tail = (width & 31) ? (1u << (width & 31)) - 1u : ~0u;
    bool cleared = false;
    for (int32_t row = height - 1; row >= 0; --row) {
        const uint32_t *mid = bit_row(r, row);
        const uint32_t *up = row > 0 ? bit_row(r, row - 1) : nullptr;
        const uint32_t *down = row + 1 < height ? bit_row(r, row + 1) : nullptr;
        const auto *pa = static_cast<const uint8_t *>(plx_image_row(a, row));
        const auto *pb = static_cast<const uint8_t *>(plx_image_row(b, row));
        uint32_t *out = bit_row(w, row);
        for (int32_t i = words - 1; i >= 0; --i) {
            const uint32_t set = mid[i] & (i == words - 1 ? tail : ~0u);
            uint32_t boundary = set & ~all_neighbours_set(up, mid, down, i, words, tail);
            while (boundary != 0) {
                const int bit = 31 - __builtin_clz(boundary);
                boundary &= ~(1u << bit);
                const int32_t c = i * 32 + bit;
                const uint8_t *x = pa + 3 * c, *y = pb + 3 * c;
                if (std::abs(int(x[0]) - int(y[0])) < threshold && std::abs(int(x[1]) - int(y[1])) < threshold &&
                    std::abs(int(x[2]) - int(y[2])) < threshold) {
                    out[i] &= ~(1u << bit);
                    cleared = true;
                }
            }
        }
    }
    return cleared;
}

void copy_bits(const Plx_Image *from, Plx_Image *to)
{
    const std::size_t bytes = std::size_t(words_of(from->width)) * 4;
    for (int32_t r = 0; r < from->height; ++r) std::memcpy(plx_image_row(to, r), plx_image_row(from, r), bytes);
}

bool is_rgb8_of(const Plx_Image *im, const Plx_Image *mask)
{
    return im->format == PLX_FORMAT_RGB && im->type == PLX_TYPE_UCHAR && im->height == mask->height &&
           im->width == mask->width;
}

}  // namespace

extern "C" {

PLANO_API Plx_Image *pgiTrackBuildMask(const Plx_Image *image_a, const Plx_Image *image_b, const Plx_Image *mask,
                                       int32_t threshold, Plx_Image *result)
{
    if (image_a == nullptr || image_b == nullptr || mask == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null image or mask", 0);
        return nullptr;
    }
    if (mask->type != PLX_TYPE_BIT) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "the mask must be a bit image", mask->type);
        return nullptr;
    }
    if (!is_rgb8_of(image_a, mask) || !is_rgb8_of(image_b, mask)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "images must be 8-bit RGB of the mask's size", 0);
        return nullptr;
    }
    if (result == image_a || result == image_b) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the result cannot be one of the images", 0);
        return nullptr;
    }
    // Peeling works on a private copy, so a result buffer that is the mask itself is fine.
    OwnedImage work, current;
    if (!work.form(nullptr, PLX_FORMAT_GREY, PLX_TYPE_BIT, mask->height, mask->width) ||
        !current.form(nullptr, PLX_FORMAT_GREY, PLX_TYPE_BIT, mask->height, mask->width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    copy_bits(mask, current.image);
    copy_bits(mask, work.image);
    if (threshold > 0)
        while (peel_pass(image_a, image_b, current.image, work.image, threshold)) copy_bits(work.image, current.image);
    if (result == nullptr) return current.release();
    if (result != mask && !plx_image_set_gen(result, PLX_FORMAT_GREY, PLX_TYPE_BIT, mask->height, mask->width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    copy_bits(current.image, result);
    return result;
}

PLANO_API Plx_Image *pgiTrackCombineMask(const Plx_Image *image, const Plx_Image *mask, int32_t row0, int32_t col0,
                                         uint32_t height, uint32_t width, Plx_Image *result)
{
    if (image == nullptr || mask == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null image or mask", 0);
        return nullptr;
    }
    if (mask->type != PLX_TYPE_BIT) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "the mask must be a bit image", mask->type);
        return nullptr;
    }
    const uint32_t channels = plx_image_format_channels(image->format);
    const uint32_t value_size = plx_image_type_size(image->type);
    if (channels == 0 || value_size == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "the image must have whole-byte pixels", image->type);
        return nullptr;
    }
    if (mask->height != image->height || mask->width != image->width) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the mask must have the image's size", 0);
        return nullptr;
    }
    if (height > INT32_MAX || width > INT32_MAX) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "window too large", 0);
        return nullptr;
    }
    if (result == image || result == mask) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the result cannot be the image or the mask", 0);
        return nullptr;
    }
    OwnedImage out;
    if (!out.form(result, image->format, image->type, int32_t(height), int32_t(width)) ||
        !plx_image_fill_zero(out.image)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    const std::size_t pixel = std::size_t(channels) * value_size;
    // Only the part of the window that lies inside the image can hold masked pixels.
    const int64_t r_lo = std::max<int64_t>(0, -int64_t(row0));
    const int64_t r_hi = std::min<int64_t>(height, int64_t(image->height) - row0);
    const int64_t c_lo = std::max<int64_t>(0, -int64_t(col0));
    const int64_t c_hi = std::min<int64_t>(width, int64_t(image->width) - col0);
    for (int64_t r = r_lo; r < r_hi; ++r) {
        const int32_t sr = int32_t(r + row0);
        const uint32_t *bits = bit_row(mask, sr);
        const auto *src = static_cast<const uint8_t *>(plx_image_row(image, sr));
        auto *dst = static_cast<uint8_t *>(plx_image_row(out.image, int32_t(r)));
        for (int64_t c = c_lo; c < c_hi; ++c) {
            const int32_t sc = int32_t(c + col0);
            if (test_bit(bits, sc)) std::memcpy(dst + std::size_t(c) * pixel, src + std::size_t(sc) * pixel, pixel);
        }
    }
    return out.release();
}

}  // extern "C"
