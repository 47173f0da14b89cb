// The masked 3-tap smoothing of the homography optimiser's pixel images. It runs on every
// pyramid level of every frame, so each stripe walks raw rows and the unmasked case has a
// branch-free inner loop over the interior columns.
#include <cstring>
#include <utility>

#include "plano/track_pixels.h"
#include "track/track_pixels_internal.hpp"

namespace {

using namespace plano::track;

template <class T>
struct Taps {
    static constexpr T third = T(1) / T(3);
    static constexpr T sixth = T(1) / T(6);
    static constexpr T two_thirds = T(2) / T(3);
};

// One stripe; C channels per pixel, smoothed independently.
template <class T, int C, bool Masked>
void smooth_rows(const TrackSmoothJob &job)
{
    const Plx_Image *src = job.source;
    Plx_Image *dst = job.dest;
    const int32_t h = src->height, w = src->width;
    constexpr T k3 = Taps<T>::third, k6 = Taps<T>::sixth, k23 = Taps<T>::two_thirds;
    for (uint32_t rr = 0; rr < job.row_count; ++rr) {
        const int32_t r = int32_t(job.first_row + rr);
        const T *mid = static_cast<const T *>(plx_image_row(src, r));
        T *out = static_cast<T *>(plx_image_row(dst, r));
        const bool inner_row = r > 0 && r < h - 1;
        const T *up = inner_row ? static_cast<const T *>(plx_image_row(src, r - 1)) : nullptr;
        const T *down = inner_row ? static_cast<const T *>(plx_image_row(src, r + 1)) : nullptr;
        const uint32_t *m_mid = nullptr, *m_up = nullptr, *m_down = nullptr;
        if constexpr (Masked) {
            m_mid = bit_row(job.mask, r);
            m_up = inner_row ? bit_row(job.mask, r - 1) : nullptr;
            m_down = inner_row ? bit_row(job.mask, r + 1) : nullptr;
        }
        auto usable = [](const uint32_t *bits, int32_t c) {
            if constexpr (Masked) return test_bit(bits, c);
            else return (void)bits, (void)c, true;
        };
        auto vertical = [&](int32_t c) {
            for (int k = 0; k < C; ++k)
                out[c * C + k] = (up[c * C + k] + down[c * C + k]) * k6 + mid[c * C + k] * k23;
        };
        auto horizontal = [&](int32_t c) {
            for (int k = 0; k < C; ++k)
                out[c * C + k] = (mid[(c - 1) * C + k] + mid[(c + 1) * C + k]) * k6 + mid[c * C + k] * k23;
        };
        auto keep = [&](int32_t c) {
            for (int k = 0; k < C; ++k) out[c * C + k] = mid[c * C + k];
        };
        if (!inner_row) {
            // Only the horizontal rule can apply on the first and last rows.
            for (int32_t c = 0; c < w; ++c) {
                if (c > 0 && c < w - 1 && usable(m_mid, c - 1) && usable(m_mid, c) && usable(m_mid, c + 1))
                    horizontal(c);
                else
                    keep(c);
            }
            continue;
        }
        auto edge_column = [&](int32_t c) {
            if (usable(m_up, c) && usable(m_mid, c) && usable(m_down, c)) vertical(c);
            else keep(c);
        };
        edge_column(0);
        if constexpr (!Masked) {
            for (int32_t c = 1; c < w - 1; ++c)
                for (int k = 0; k < C; ++k) {
                    const int32_t i = c * C + k;
                    out[i] = mid[i] * k3 + (up[i] + down[i] + mid[i - C] + mid[i + C]) * k6;
                }
        } else {
            for (int32_t c = 1; c < w - 1; ++c) {
                const bool centre = test_bit(m_mid, c);
                const bool v = centre && test_bit(m_up, c) && test_bit(m_down, c);
                const bool hz = centre && test_bit(m_mid, c - 1) && test_bit(m_mid, c + 1);
                if (v && hz) {
                    for (int k = 0; k < C; ++k) {
                        const int32_t i = c * C + k;
                        out[i] = mid[i] * k3 + (up[i] + down[i] + mid[i - C] + mid[i + C]) * k6;
                    }
                } else if (v) {
                    vertical(c);
                } else if (hz) {
                    horizontal(c);
                } else {
                    keep(c);
                }
            }
        }
        if (w > 1) edge_column(w - 1);
    }
}

template <class T, int C>
void smooth_dispatch_mask(const TrackSmoothJob &job)
{
    if (job.mask != nullptr) smooth_rows<T, C, true>(job);
    else smooth_rows<T, C, false>(job);
}

bool smoothable(const Plx_Image *im)
{
    const bool format = im->format == PLX_FORMAT_GREY || im->format == PLX_FORMAT_RGB || im->format == PLX_FORMAT_BGR;
    return format && (im->type == PLX_TYPE_FLOAT || im->type == PLX_TYPE_DOUBLE);
}

void copy_rows(const Plx_Image *from, Plx_Image *to)
{
    const std::size_t bytes =
        std::size_t(from->width) * plx_image_format_channels(from->format) * plx_image_type_size(from->type);
    for (int32_t r = 0; r < from->height; ++r) std::memcpy(plx_image_row(to, r), plx_image_row(from, r), bytes);
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool gbSmoothImage(void *job_record)
{
    const auto *job = static_cast<const TrackSmoothJob *>(job_record);
    if (job == nullptr || job->source == nullptr || job->dest == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "incomplete smoothing job", 0);
        return 0;
    }
    const Plx_Image *s = job->source;
    const Plx_Image *d = job->dest;
    if (!smoothable(s)) {
        PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "only grey and RGB float or double images are smoothed", s->type);
        return 0;
    }
    if (d->format != s->format || d->type != s->type || d->height != s->height || d->width != s->width ||
        d == s || (job->mask != nullptr && !is_mask_of(job->mask, s->height, s->width)) ||
        uint64_t(job->first_row) + job->row_count > uint64_t(s->height)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "images, mask and rows of the job do not fit together", 0);
        return 0;
    }
    const bool grey = s->format == PLX_FORMAT_GREY;
    if (s->type == PLX_TYPE_FLOAT) grey ? smooth_dispatch_mask<float, 1>(*job) : smooth_dispatch_mask<float, 3>(*job);
    else grey ? smooth_dispatch_mask<double, 1>(*job) : smooth_dispatch_mask<double, 3>(*job);
    return 1;
}

PLANO_API Plx_Image *pgiSmoothImage(const Plx_Image *image, const Plx_Image *mask, uint32_t passes, Plx_Image *result,
                                    Plx_Image *second, const ThreadHostInterface *host)
{
    if (image == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null image", 0);
        return nullptr;
    }
    if (mask != nullptr && !is_mask_of(mask, image->height, image->width)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the mask must be a bit image of the image's size", 0);
        return nullptr;
    }
    if (result != nullptr && (result == image || result == mask || result == second)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the result buffer must be an image of its own", 0);
        return nullptr;
    }
    if (second != nullptr && (second == image || second == mask)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the second buffer must be an image of its own", 0);
        return nullptr;
    }
    // The checks that need no pixels come first, so a refused call leaves the buffers alone.
    const Plx_ImageFormat format = image->format;
    if (passes > 0 && format != PLX_FORMAT_GREY && format != PLX_FORMAT_RGB && format != PLX_FORMAT_BGR) {
        PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "only grey and RGB images are smoothed", format);
        return nullptr;
    }
    const uint32_t n = plano::job_count(host);
    plx::HeapPtr<TrackSmoothJob> jobs(PLX_ALLOC(TrackSmoothJob, n));
    if (!jobs) return nullptr;

    OwnedImage first;
    first.image = plx_image_convert_q(image, PLX_FORMAT_NONE, PLX_TYPE_FLOAT, result);
    first.owned = first.image != nullptr && result == nullptr;
    if (first.image == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    if (passes == 0 || image->height == 0 || image->width == 0) return first.release();
    OwnedImage other;
    if (!other.form(second, format, PLX_TYPE_FLOAT, image->height, image->width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    Plx_Image *from = first.image, *to = other.image;
    for (uint32_t pass = 0; pass < passes; ++pass) {
        for (uint32_t i = 0; i < n; ++i) {
            const plano::Band band = plano::band_of(i, n, uint32_t(image->height));
            jobs.get()[i] = TrackSmoothJob{from, to, mask, band.first, band.count};
        }
        if (!run_stripes("pgiSmoothImage", host, gbSmoothImage, jobs.get(), n)) return nullptr;
        std::swap(from, to);
    }
    if (from != first.image) copy_rows(from, first.image);
    return first.release();
}

}  // extern "C"
