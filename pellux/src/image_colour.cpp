// Colour to luminance, and the 8-bit level table.
#include "image_internal.hpp"
#include "image_ops.hpp"

extern "C" {

PLX_API double plx_rgb_to_luminance(double r, double g, double b)
{
    return 0.2126 * r + 0.7152 * g + 0.0722 * b;
}

PLX_API Plx_Image *plx_image_colour_to_grey_q(const Plx_Image *source, Plx_PixelType type, Plx_Image *dest)
{
    if (!plx::check_image(source, __func__)) return nullptr;
    switch (source->format) {
    case PLX_FORMAT_RGB:
    case PLX_FORMAT_RGBA:
    case PLX_FORMAT_BGR:
    case PLX_FORMAT_BGRA:
        break;
    default:
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "not a colour image", source->format);
        return nullptr;
    }
    Plx_Image *out = plx_image_convert_q(source, PLX_FORMAT_GREY, type, dest);
    if (out == nullptr) PLX_ERR_PASS();
    return out;
}

#define PLX_L1(i) static_cast<float>(i) / 255.0f
#define PLX_L4(i) PLX_L1(i), PLX_L1(i + 1), PLX_L1(i + 2), PLX_L1(i + 3)
#define PLX_L16(i) PLX_L4(i), PLX_L4(i + 4), PLX_L4(i + 8), PLX_L4(i + 12)
#define PLX_L64(i) PLX_L16(i), PLX_L16(i + 16), PLX_L16(i + 32), PLX_L16(i + 48)
const float lookup_table_8bit[256] = {PLX_L64(0), PLX_L64(64), PLX_L64(128), PLX_L64(192)};
#undef PLX_L64
#undef PLX_L16
#undef PLX_L4
#undef PLX_L1

}  // extern "C"
