// The correlation image: argument checks, the texture mask, and the stripes over host jobs.
#include <algorithm>
#include <cmath>
#include <cstring>
#include <mutex>

#include "pellux/detail/pixel_traits.hpp"
#include "plano/track_correlation.h"
#include "track/track_pixels_internal.hpp"

namespace {

using namespace plano::track;

// Squared central-difference gradients in a form that cannot overflow: 8-bit differences as
// they are; 16-bit, int and unsigned int differences divided down (by 4, and by 65536) so
// that their squares stay within 31 bits of range; floating types as they are (1 is full
// scale). The squared threshold uses the same units, capped at the largest 31-bit value as
// the integer forms are.
template <class T>
struct TextureUnits {
    static double difference(T a, T b)
    {
        if constexpr (std::is_same_v<T, uint8_t>) return double(int32_t(a) - int32_t(b));
        else if constexpr (std::is_same_v<T, uint16_t>) return double((int32_t(a) - int32_t(b)) / 4);
        else if constexpr (std::is_integral_v<T>) return (double(a) - double(b)) / 65536.0;
        else return double(a) - double(b);
    }
    static double squared_threshold(double t)
    {
        double v;
        if constexpr (std::is_same_v<T, uint8_t>) v = (255.0 * t) * (255.0 * t);
        else if constexpr (std::is_same_v<T, uint16_t>) v = (65535.0 * t) * (65535.0 * t) / 16.0;
        else if constexpr (std::is_integral_v<T>) v = (4294967295.0 * t / 65536.0) * (4294967295.0 * t / 65536.0);
        else return t * t;
        return std::min(v, 2147483647.0);
    }
};

// Clears (in keep, a bit image of the template's size already holding the candidate pixels)
// every pixel on the border or whose gradient is below the threshold.
template <class T>
void texture_select(const Plx_Image *tpl, double threshold, Plx_Image *keep)
{
    const int32_t h = tpl->height, w = tpl->width;
    const int cs = int(plx_image_format_channels(tpl->format));
    const int used = cs == 1 ? 1 : 3;
    const double t2 = TextureUnits<T>::squared_threshold(threshold);
    for (int32_t r = 0; r < h; ++r) {
        uint32_t *bits = bit_row(keep, r);
        if (r == 0 || r == h - 1) {
            std::fill(bits, bits + words_of(w), 0u);
            continue;
        }
        const T *up = static_cast<const T *>(plx_image_row(tpl, r - 1));
        const T *mid = static_cast<const T *>(plx_image_row(tpl, r));
        const T *down = static_cast<const T *>(plx_image_row(tpl, r + 1));
        clear_bit(bits, 0);
        if (w > 1) clear_bit(bits, w - 1);
        for (int32_t c = 1; c < w - 1; ++c) {
            if (!test_bit(bits, c)) continue;
            double g = 0;
            for (int k = 0; k < used; ++k) {
                const double dy = TextureUnits<T>::difference(down[c * cs + k], up[c * cs + k]);
                const double dx = TextureUnits<T>::difference(mid[(c + 1) * cs + k], mid[(c - 1) * cs + k]);
                g += dy * dy + dx * dx;
            }
            if (g < t2) clear_bit(bits, c);
        }
    }
}

// The weight the correlation uses when a texture threshold is given: a bit image (absent
// or bit weight) or a 16-bit weight copy with the untextured pixels zeroed.
Plx_Image *texture_weight(const Plx_Image *tpl, const Plx_Image *weight, double threshold)
{
    const int32_t h = tpl->height, w = tpl->width;
    OwnedImage keep;
    if (!keep.form(nullptr, PLX_FORMAT_GREY, PLX_TYPE_BIT, h, w)) return nullptr;
    for (int32_t r = 0; r < h; ++r) {
        uint32_t *bits = bit_row(keep.image, r);
        if (weight == nullptr) {
            std::fill(bits, bits + words_of(w), 0u);
            for (int32_t c = 0; c < w; ++c) set_bit(bits, c);
        } else if (weight->type == PLX_TYPE_BIT) {
            std::memcpy(bits, bit_row(weight, r), std::size_t(words_of(w)) * 4);
        } else {
            std::fill(bits, bits + words_of(w), 0u);
            const auto *ws = static_cast<const uint16_t *>(plx_image_row(weight, r));
            for (int32_t c = 0; c < w; ++c)
                if (ws[c] != 0) set_bit(bits, c);
        }
    }
    plx::dispatch_numeric_type(tpl->type, [&](auto t) { texture_select<decltype(t)>(tpl, threshold, keep.image); });
    if (weight == nullptr || weight->type == PLX_TYPE_BIT) return keep.release();
    OwnedImage copy;
    if (!copy.form(nullptr, PLX_FORMAT_GREY, PLX_TYPE_USHORT, h, w)) return nullptr;
    for (int32_t r = 0; r < h; ++r) {
        const uint32_t *bits = bit_row(keep.image, r);
        const auto *ws = static_cast<const uint16_t *>(plx_image_row(weight, r));
        auto *out = static_cast<uint16_t *>(plx_image_row(copy.image, r));
        for (int32_t c = 0; c < w; ++c) out[c] = test_bit(bits, c) ? ws[c] : uint16_t(0);
    }
    return copy.release();
}

bool correlatable_type(Plx_PixelType type)
{
    return type == PLX_TYPE_UCHAR || type == PLX_TYPE_USHORT || type == PLX_TYPE_INT || type == PLX_TYPE_UINT ||
           type == PLX_TYPE_FLOAT || type == PLX_TYPE_DOUBLE;
}

}  // namespace

extern "C" {

PLANO_API Plx_Image *pgiTrackImageCorrelate2D_q(const ThreadHostInterface *host, const Plx_Image *template_image,
                                                const Plx_Image *template_weight, const Plx_Image *search_image,
                                                const Plx_Image *search_mask, double texture_threshold,
                                                Plx_Image *result, StatusTime *status_time, double time_share)
{
    if (template_image == nullptr || search_image == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null template or search image", 0);
        return nullptr;
    }
    const Plx_Image *tpl = template_image;
    if (tpl->format != PLX_FORMAT_GREY && tpl->format != PLX_FORMAT_RGB && tpl->format != PLX_FORMAT_RGBA) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "templates are grey, RGB or RGBA", tpl->format);
        return nullptr;
    }
    if (!correlatable_type(tpl->type)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "unsupported template pixel type", tpl->type);
        return nullptr;
    }
    if (search_image->format != tpl->format || search_image->type != tpl->type) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the search image must have the template's format and type", 0);
        return nullptr;
    }
    if (tpl->height < 1 || tpl->width < 1 || search_image->height < tpl->height || search_image->width < tpl->width) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the template must be non-empty and fit inside the search image", 0);
        return nullptr;
    }
    if (template_weight != nullptr &&
        (template_weight->height != tpl->height || template_weight->width != tpl->width ||
         template_weight->format != PLX_FORMAT_GREY ||
         (template_weight->type != PLX_TYPE_BIT && template_weight->type != PLX_TYPE_USHORT))) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the weight must be a bit or 16-bit grey image of the template's size", 0);
        return nullptr;
    }
    if (search_mask != nullptr && !is_mask_of(search_mask, search_image->height, search_image->width)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the search mask must be a bit image of the search image's size", 0);
        return nullptr;
    }
    if (result != nullptr && (result == template_image || result == search_image || result == template_weight ||
                              result == search_mask)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the result buffer must be an image of its own", 0);
        return nullptr;
    }
    const uint32_t n = plano::job_count(host);
    plx::HeapPtr<CorrelationJob> jobs(PLX_ALLOC(CorrelationJob, n));
    if (!jobs) return nullptr;

    OwnedImage textured;
    const Plx_Image *weight = template_weight;
    if (texture_threshold > 0) {
        textured.image = texture_weight(tpl, template_weight, texture_threshold);
        textured.owned = textured.image != nullptr;
        if (textured.image == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
        weight = textured.image;
        if (status_time != nullptr)
            vStatusTimeIncrement(status_time, 0.1 * time_share, host != nullptr ? host->progress : nullptr,
                                 host != nullptr ? host->callback_context : nullptr);
    }
    const bool wide = tpl->type == PLX_TYPE_INT || tpl->type == PLX_TYPE_UINT || tpl->type == PLX_TYPE_DOUBLE;
    const int32_t height = search_image->height - tpl->height + 1;
    const int32_t width = search_image->width - tpl->width + 1;
    OwnedImage out;
    if (!out.form(result, search_mask != nullptr ? PLX_FORMAT_VECTOR2D : PLX_FORMAT_GREY,
                  wide ? PLX_TYPE_DOUBLE : PLX_TYPE_FLOAT, height, width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    std::mutex guard;
    for (uint32_t i = 0; i < n; ++i) {
        const plano::Band band = plano::band_of(i, n, uint32_t(height));
        jobs.get()[i] = CorrelationJob{host,       tpl,        weight,      search_image, search_mask,
                                       out.image,  band.first, band.count,  status_time,  time_share, &guard};
    }
    if (!run_stripes("pgiTrackImageCorrelate2D_q", host, gbApplyCorrelationToWindow, jobs.get(), n)) return nullptr;
    return out.release();
}

}  // extern "C"
