// Reading, writing and converting single pixels.
#include <cstring>

#include "image_internal.hpp"
#include "image_ops.hpp"
#include "pellux/detail/pixel_traits.hpp"

namespace {

// Address of pixel (row, col) of a byte-addressed image.
inline void *pixel_address(const Plx_Image *image, int32_t row, int32_t col)
{
    std::size_t px = static_cast<std::size_t>(plx_image_format_channels(image->format)) *
                     plx_image_type_size(image->type);
    return static_cast<char *>(plx_image_row(image, row)) + static_cast<std::size_t>(col) * px;
}

bool check_pixel_args(const Plx_Image *image, int32_t row, int32_t col, const void *values,
                      const char *fn)
{
    if (!plx::check_value_image(image, fn)) return false;
    if (values == nullptr) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_ARGUMENT, "null values", 0);
        return false;
    }
    return plx::check_inside(image, row, col, fn);
}

bool check_pointer_pixel(const Plx_Image *image, int32_t row, int32_t col, const char *fn)
{
    if (!plx::check_image(image, fn)) return false;
    if (image->type != PLX_TYPE_POINTER) {
        PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "not a pointer image", image->type);
        return false;
    }
    return plx::check_inside(image, row, col, fn);
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_image_get_pixel(const Plx_Image *image, int32_t row, int32_t col, double *values)
{
    if (!check_pixel_args(image, row, col, values, __func__)) return 0;
    if (image->type == PLX_TYPE_BIT) {
        values[0] = plx::get_bit(plx::bit_row(image, row), col) ? 1.0 : 0.0;
        return 1;
    }
    const uint32_t ch = plx_image_format_channels(image->format);
    plx::dispatch_numeric_type(image->type, [&](auto v) {
        using T = decltype(v);
        const T *p = static_cast<const T *>(pixel_address(image, row, col));
        for (uint32_t k = 0; k < ch; ++k) values[k] = static_cast<double>(p[k]);
    });
    return 1;
}

PLX_API Plx_Bool plx_image_set_pixel(Plx_Image *image, int32_t row, int32_t col, const double *values)
{
    if (!check_pixel_args(image, row, col, values, __func__)) return 0;
    if (image->type == PLX_TYPE_BIT) {
        plx::set_bit(plx::bit_row(image, row), col, values[0] >= 0.5);
        return 1;
    }
    const uint32_t ch = plx_image_format_channels(image->format);
    plx::dispatch_numeric_type(image->type, [&](auto v) {
        using T = decltype(v);
        T *p = static_cast<T *>(pixel_address(image, row, col));
        for (uint32_t k = 0; k < ch; ++k) p[k] = plx::saturate<T>(values[k]);
    });
    return 1;
}

PLX_API Plx_Bool plx_image_convert_pixel(const Plx_Image *source, int32_t srow, int32_t scol,
                                         Plx_Image *dest, int32_t drow, int32_t dcol)
{
    if (!plx::check_image(source, __func__) || !plx::check_image(dest, __func__)) return 0;
    if (!plx::check_conversion(source->format, source->type, dest->format, dest->type, __func__))
        return 0;
    if (!plx::check_inside(source, srow, scol, __func__) || !plx::check_inside(dest, drow, dcol, __func__))
        return 0;
    if (source->format == dest->format && source->type == dest->type) {
        if (source->type == PLX_TYPE_BIT)
            plx::set_bit(plx::bit_row(dest, drow), dcol, plx::get_bit(plx::bit_row(source, srow), scol));
        else
            std::memmove(pixel_address(dest, drow, dcol), pixel_address(source, srow, scol),
                         plx_image_format_channels(source->format) * plx_image_type_size(source->type));
        return 1;
    }
    double scratch[plx::RowConverter::scratch_size(1)];
    plx::RowConverter(source, dest).convert(source, srow, scol, dest, drow, dcol, 1, scratch);
    return 1;
}

PLX_API Plx_Bool plx_image_get_bit(const Plx_Image *image, int32_t row, int32_t col)
{
    if (!plx::check_bit_image(image, __func__) || !plx::check_inside(image, row, col, __func__)) return 0;
    return plx::get_bit(plx::bit_row(image, row), col) ? 1 : 0;
}

PLX_API void plx_image_set_bit(Plx_Image *image, int32_t row, int32_t col, Plx_Bool value)
{
    if (!plx::check_bit_image(image, __func__) || !plx::check_inside(image, row, col, __func__)) return;
    plx::set_bit(plx::bit_row(image, row), col, value != 0);
}

PLX_API void *plx_image_get_pointer(const Plx_Image *image, int32_t row, int32_t col)
{
    if (!check_pointer_pixel(image, row, col, __func__)) return nullptr;
    void *p;
    std::memcpy(&p, pixel_address(image, row, col), sizeof p);
    return p;
}

PLX_API void plx_image_set_pointer(Plx_Image *image, int32_t row, int32_t col, void *value)
{
    if (!check_pointer_pixel(image, row, col, __func__)) return;
    std::memcpy(pixel_address(image, row, col), &value, sizeof value);
}

}  // extern "C"
