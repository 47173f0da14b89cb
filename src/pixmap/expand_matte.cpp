// Growing and shrinking the set region of a bit image by a square neighbourhood.
#include "common/internal.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "plano/polygon_fill.h"

extern "C" {

PLANO_API Plx_Bool bExpandMatte(Plx_Image *image, int32_t n)
{
    if (!plano::pixmap::check_bit_image(image, __func__)) return 0;
    if (n == 0 || image->width == 0 || image->height == 0) return 1;
    // Shrinking the set pixels is growing the unset ones.
    const bool shrink = n < 0;
    const uint32_t radius = shrink ? uint32_t(-(int64_t(n))) : uint32_t(n);
    if (shrink && !plx_image_bit_invert_q(image, image)) {
        PLX_ERR_PASS();
        return 0;
    }
    if (!plx_image_bit_dilate_x_q(image, radius, image) || !plx_image_bit_dilate_y_q(image, radius, image) ||
        (shrink && !plx_image_bit_invert_q(image, image))) {
        PLX_ERR_PASS();
        return 0;
    }
    return 1;
}

}  // extern "C"
