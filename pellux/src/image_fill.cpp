// Filling images, in whole or in a window, and the active subwindow of any image.
#include <algorithm>
#include <cstring>

#include "image_internal.hpp"
#include "image_ops.hpp"
#include "pellux/detail/pixel_traits.hpp"

namespace {

Plx_Bool fill_zero_window(Plx_Image *image, Plx_Window w)
{
    if (w.width == 0 || w.height == 0) return 1;
    if (image->type == PLX_TYPE_BIT) {
        for (int32_t r = 0; r < w.height; ++r) plx::fill_bits(plx::bit_row(image, w.y + r), w.x, w.width, false);
        return 1;
    }
    // All-zero bytes are 0 in every numeric type and a null pointer on our platforms.
    std::size_t px = static_cast<std::size_t>(plx_image_format_channels(image->format)) *
                     plx_image_type_size(image->type);
    for (int32_t r = 0; r < w.height; ++r)
        std::memset(static_cast<char *>(plx_image_row(image, w.y + r)) + static_cast<std::size_t>(w.x) * px, 0,
                    static_cast<std::size_t>(w.width) * px);
    return 1;
}

Plx_Bool fill_const_window(Plx_Image *image, Plx_Window w, const double *values)
{
    if (w.width == 0 || w.height == 0) return 1;
    if (image->type == PLX_TYPE_BIT) {
        bool v = values[0] >= 0.5;
        for (int32_t r = 0; r < w.height; ++r) plx::fill_bits(plx::bit_row(image, w.y + r), w.x, w.width, v);
        return 1;
    }
    const uint32_t ch = plx_image_format_channels(image->format);
    plx::dispatch_numeric_type(image->type, [&](auto tag) {
        using T = decltype(tag);
        T pixel[4];
        for (uint32_t k = 0; k < ch; ++k) pixel[k] = plx::saturate<T>(values[k]);
        for (int32_t r = 0; r < w.height; ++r) {
            T *p = static_cast<T *>(plx_image_row(image, w.y + r)) + static_cast<std::size_t>(w.x) * ch;
            if (ch == 1) {
                std::fill(p, p + w.width, pixel[0]);
            } else {
                for (int32_t c = 0; c < w.width; ++c, p += ch)
                    for (uint32_t k = 0; k < ch; ++k) p[k] = pixel[k];
            }
        }
    });
    return 1;
}

bool check_fill(const Plx_Image *image, Plx_Window w, const double *values, bool need_value,
                const char *fn)
{
    if (!plx::check_image(image, fn)) return false;
    if (need_value) {
        if (image->type == PLX_TYPE_POINTER) {
            PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "pointer pixels have no value", image->type);
            return false;
        }
        if (values == nullptr) {
            PLX_ERR_START_FN(fn, PLX_ERROR_ILLEGAL_ARGUMENT, "null values", 0);
            return false;
        }
    }
    return plx::check_window(image, w, fn);
}

inline Plx_Window whole(const Plx_Image *image)
{
    return image ? Plx_Window{0, 0, image->width, image->height} : Plx_Window{0, 0, 0, 0};
}

// Bounding box of the pixels with a nonzero channel, for one value type T (pointers are
// compared as addresses). Each row is scanned from both ends only until its first hit.
template <class T>
Plx_Window nonzero_box(const Plx_Image *image)
{
    const std::size_t ch = plx_image_format_channels(image->format);
    const int32_t w = image->width;
    int32_t x0 = w, x1 = -1, y0 = -1, y1 = -1;
    for (int32_t r = 0; r < image->height; ++r) {
        const T *p = static_cast<const T *>(plx_image_row(image, r));
        auto set = [&](int32_t c) {
            for (std::size_t k = 0; k < ch; ++k)
                if (p[static_cast<std::size_t>(c) * ch + k] != T{}) return true;
            return false;
        };
        int32_t first = 0;
        while (first < w && !set(first)) ++first;
        if (first == w) continue;
        int32_t last = w - 1;
        while (last > first && !set(last)) --last;
        x0 = std::min(x0, first);
        x1 = std::max(x1, last);
        if (y0 < 0) y0 = r;
        y1 = r;
    }
    return y0 < 0 ? Plx_Window{0, 0, 0, 0} : Plx_Window{x0, y0, x1 - x0 + 1, y1 - y0 + 1};
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_image_fill_zero(Plx_Image *image)
{
    if (!check_fill(image, whole(image), nullptr, false, __func__)) return 0;
    return fill_zero_window(image, whole(image));
}

PLX_API Plx_Bool plx_image_fill_zero_window(Plx_Image *image, Plx_Window window)
{
    if (!check_fill(image, window, nullptr, false, __func__)) return 0;
    return fill_zero_window(image, window);
}

PLX_API Plx_Bool plx_image_fill_const(Plx_Image *image, const double *values)
{
    if (!check_fill(image, whole(image), values, true, __func__)) return 0;
    return fill_const_window(image, whole(image), values);
}

PLX_API Plx_Bool plx_image_fill_const_window(Plx_Image *image, Plx_Window window, const double *values)
{
    if (!check_fill(image, window, values, true, __func__)) return 0;
    return fill_const_window(image, window, values);
}

PLX_API Plx_Bool plx_image_get_active_subwindow(const Plx_Image *image, Plx_Window *window)
{
    if (!plx::check_image(image, __func__)) return 0;
    if (window == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null window", 0);
        return 0;
    }
    if (image->type == PLX_TYPE_BIT) {
        if (!plx_image_get_active_subwindow_b(image, window)) {
            PLX_ERR_PASS();
            return 0;
        }
        return 1;
    }
    if (image->type == PLX_TYPE_POINTER) {
        *window = nonzero_box<const void *>(image);
        return 1;
    }
    plx::dispatch_numeric_type(image->type, [&](auto tag) { *window = nonzero_box<decltype(tag)>(image); });
    return 1;
}

}  // extern "C"
