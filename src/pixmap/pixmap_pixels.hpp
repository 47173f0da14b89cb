// Pixels given as doubles (stored numbers, one per channel) turned into a pixel type, and
// written over runs of a row; the switch from an image's pixel type to that C++ type.
#ifndef PLANO_SRC_PIXMAP_PIXMAP_PIXELS_HPP
#define PLANO_SRC_PIXMAP_PIXMAP_PIXELS_HPP

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <limits>

#include "pellux/detail/pixel_traits.hpp"
#include "pellux/error.h"

namespace plano::pixmap {

// Calls f(T{}) with T the C++ type of image's pixels, for images of numbers: a format with
// channels other than pointers (else code 39) and a numeric type (else code 38), registered
// under function.
template <class F>
bool with_pixel_type(const Plx_Image *image, const char *function, F &&f)
{
    if (plx_image_format_channels(image->format) == 0 || image->format == PLX_FORMAT_POINTER) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_FORMAT, "not an image of numbers", int64_t(image->format));
        return false;
    }
    if (!plx::dispatch_numeric_type(image->type, f)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "pixel type", int64_t(image->type));
        return false;
    }
    return true;
}

// The stored number v in type T: integers round to nearest (halves away from zero) and clamp,
// as plx_image_set_pixel stores them.
template <class T>
inline T to_pixel(double v)
{
    if constexpr (plx::PixelTraits<T>::integral) {
        constexpr double lo = double(std::numeric_limits<T>::lowest()), hi = double(std::numeric_limits<T>::max());
        if (!(v >= lo)) return std::numeric_limits<T>::lowest();
        if (v >= hi) return std::numeric_limits<T>::max();
        return T(v < 0 ? v - 0.5 : v + 0.5);
    } else {
        return T(v);
    }
}

template <class T>
class PixelValue {
public:
    PixelValue(const double *pixel, uint32_t channels) : channels_(std::min(channels, 4u))
    {
        for (uint32_t k = 0; k < channels_; ++k) v_[k] = to_pixel<T>(pixel[k]);
    }
    // Pixels first..last (inclusive) of a row.
    void write_span(T *row, int32_t first, int32_t last) const
    {
        if (channels_ == 1) {
            if constexpr (sizeof(T) == 1)
                std::memset(row + first, int(v_[0]), std::size_t(last - first + 1));
            else
                std::fill(row + first, row + last + 1, v_[0]);
            return;
        }
        T *p = row + std::size_t(first) * channels_;
        for (int32_t c = first; c <= last; ++c, p += channels_)
            for (uint32_t k = 0; k < channels_; ++k) p[k] = v_[k];
    }
    void write(T *row, int32_t c) const
    {
        for (uint32_t k = 0; k < channels_; ++k) row[std::size_t(c) * channels_ + k] = v_[k];
    }

private:
    uint32_t channels_;
    T v_[4] = {};
};

}  // namespace plano::pixmap

#endif
