// Argument checks and destination preparation shared by the image operations.
#include "image_internal.hpp"
#include "image_ops.hpp"

namespace plx {

bool check_image(const Plx_Image *image, const char *fn)
{
    if (image == nullptr) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_ARGUMENT, "null image", 0);
        return false;
    }
    return check_format_type(image->format, image->type, fn);
}

bool check_bit_image(const Plx_Image *image, const char *fn)
{
    if (!check_image(image, fn)) return false;
    if (image->type != PLX_TYPE_BIT) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "not a bit image", image->type);
        return false;
    }
    return true;
}

bool check_value_image(const Plx_Image *image, const char *fn)
{
    if (!check_image(image, fn)) return false;
    if (image->type == PLX_TYPE_POINTER) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "pointer pixels have no value", image->type);
        return false;
    }
    return true;
}

bool check_same_size(const Plx_Image *a, const Plx_Image *b, const char *fn)
{
    if (a->height != b->height || a->width != b->width) {
        PLX_ERR_START_FN(fn, PLX_ERROR_INCOMPATIBLE, "images differ in size", 0);
        return false;
    }
    return true;
}

bool check_inside(const Plx_Image *image, int32_t row, int32_t col, const char *fn)
{
    if (row < 0 || col < 0 || row >= image->height || col >= image->width) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_ARGUMENT, "pixel outside the image",
                         row < 0 || row >= image->height ? row : col);
        return false;
    }
    return true;
}

bool check_window(const Plx_Image *image, Plx_Window window, const char *fn)
{
    if (!window_inside(image, window)) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_ARGUMENT, "window outside the image", 0);
        return false;
    }
    return true;
}

namespace {
bool is_vector_format(Plx_ImageFormat f) { return f == PLX_FORMAT_VECTOR2D || f == PLX_FORMAT_VECTOR3D; }
}  // namespace

bool check_conversion(Plx_ImageFormat sf, Plx_PixelType st, Plx_ImageFormat df, Plx_PixelType dt,
                      const char *fn)
{
    if (!check_format_type(sf, st, fn) || !check_format_type(df, dt, fn)) return false;
    if ((st == PLX_TYPE_POINTER) != (dt == PLX_TYPE_POINTER)) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "pointer pixels convert only to pointers", dt);
        return false;
    }
    // A vector field holds displacements, not intensities: reading it as colour (or colour
    // as a field) would silently produce meaningless numbers.
    if (is_vector_format(sf) != is_vector_format(df)) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_FORMAT, "vector fields convert only to vector fields", df);
        return false;
    }
    return true;
}

bool prepare_dest(Plx_Image *dest, Plx_ImageFormat format, Plx_PixelType type, int32_t height,
                  int32_t width, const char *fn)
{
    bool has_pixels = dest->data != nullptr || height == 0 || width == 0;
    if (dest->format == format && dest->type == type && dest->height == height &&
        dest->width == width && has_pixels && dest->stride >= plx_image_min_stride(format, type, width))
        return true;
    if (!plx_image_set_gen(dest, format, type, height, width)) {
        PLX_ERR_PASS_FN(fn);
        return false;
    }
    return true;
}

Plx_Image *acquire_dest(Plx_Image *dest, Plx_ImageFormat format, Plx_PixelType type,
                        int32_t height, int32_t width, const char *fn, bool &made)
{
    made = false;
    if (dest != nullptr) return prepare_dest(dest, format, type, height, width, fn) ? dest : nullptr;
    dest = plx_image_form_gen(nullptr, format, type, height, width);
    if (dest == nullptr) {
        PLX_ERR_PASS_FN(fn);
        return nullptr;
    }
    made = true;
    return dest;
}

}  // namespace plx
