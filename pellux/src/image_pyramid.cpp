// Image pyramids built into storage that is kept from one build to the next.
#include <cstdlib>
#include <cstring>

#include "image_internal.hpp"
#include "image_ops.hpp"
#include "pellux/detail/util.hpp"

namespace {

// Releases an owned level image (levels 1 and up) and clears the slot.
void release(Plx_Image *&image)
{
    plx_image_free(image);
    image = nullptr;
}

// Halves source into slot, reusing the slot's image when there is one.
bool halve_into(const Plx_Image *source, Plx_Image *&slot)
{
    Plx_Image *out = plx_image_halve_size(source, slot);
    if (out == nullptr) return false;
    slot = out;
    return true;
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_image_pyramid_build_preallocated(Plx_ImagePyramid *pyramid, Plx_Image *image,
                                                      Plx_Image *mask, uint32_t no_levels)
{
    if (pyramid == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null pyramid", 0);
        return 0;
    }
    if (!plx::check_value_image(image, __func__)) return 0;
    if (mask != nullptr && (!plx::check_bit_image(mask, __func__) || !plx::check_same_size(image, mask, __func__)))
        return 0;
    if (no_levels == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "a pyramid needs at least one level", 0);
        return 0;
    }
    if (pyramid->capacity < pyramid->no_levels || (pyramid->capacity > 0 && pyramid->level == nullptr)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "pyramid record is not initialised", pyramid->capacity);
        return 0;
    }
    // A level with no pixels would leave coarse-to-fine work with nothing to match; refuse
    // the level count rather than hand out empty images.
    int32_t h = image->height, w = image->width;
    for (uint32_t l = 1; l < no_levels; ++l) {
        h /= 2;
        w /= 2;
        if (h == 0 || w == 0) {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "too many levels for the image size", no_levels);
            return 0;
        }
    }
    if (pyramid->capacity < no_levels) {
        auto *levels = PLX_ALLOC(Plx_PyramidLevel, no_levels);
        if (levels == nullptr) return 0;
        std::memset(static_cast<void *>(levels), 0, sizeof(Plx_PyramidLevel) * no_levels);
        if (pyramid->capacity > 0)
            std::memcpy(static_cast<void *>(levels), pyramid->level, sizeof(Plx_PyramidLevel) * pyramid->capacity);
        std::free(pyramid->level);
        pyramid->level = levels;
        pyramid->capacity = no_levels;
    }
    Plx_PyramidLevel *lv = pyramid->level;
    lv[0].image = image;  // borrowed
    lv[0].mask = mask;
    pyramid->no_levels = 1;
    for (uint32_t l = 1; l < no_levels; ++l) {
        if (!halve_into(lv[l - 1].image, lv[l].image)) {
            PLX_ERR_PASS();
            return 0;
        }
        if (mask == nullptr) {
            release(lv[l].mask);
        } else if (!halve_into(lv[l - 1].mask, lv[l].mask)) {
            PLX_ERR_PASS();
            return 0;
        }
        pyramid->no_levels = l + 1;
    }
    return 1;
}

PLX_API void plx_image_pyramid_free(Plx_ImagePyramid *pyramid)
{
    if (pyramid == nullptr) return;
    if (pyramid->level != nullptr)
        for (uint32_t l = 1; l < pyramid->capacity; ++l) {
            release(pyramid->level[l].image);
            release(pyramid->level[l].mask);
        }
    std::free(pyramid->level);
    pyramid->level = nullptr;
    pyramid->no_levels = 0;
    pyramid->capacity = 0;
}

}  // extern "C"
