// Gradient threshold and pixel sampling for the trackers that use only textured pixels.
#include <algorithm>
#include <cmath>

#include "pellux/detail/pixel_traits.hpp"
#include "plano/track_pixels.h"
#include "track/track_pixels_internal.hpp"

namespace {

using namespace plano::track;

// Grid step of a sampling value s >= 3.
uint32_t grid_step(uint32_t s) { return uint32_t(std::floor(std::sqrt(double(s) + 0.01))); }

// The sampling that thins s: 1 -> 2 -> 4 -> 9 -> 16 ...
uint64_t next_sampling(uint64_t s)
{
    if (s <= 1) return 2;
    if (s == 2) return 4;
    const uint64_t k = grid_step(uint32_t(s)) + 1;
    return k * k;
}

// Gradient value type for an input pixel type: exact integers where they fit, else the
// floating type of the input.
template <class T>
using GradientOf = std::conditional_t<std::is_same_v<T, uint8_t> || std::is_same_v<T, uint16_t>, uint32_t,
                                      std::conditional_t<std::is_same_v<T, uint32_t>, double, float>>;

struct GradientJob {
    const Plx_Image *image;
    const Plx_Image *mask;  // may be null
    int32_t row0, col0;     // the cut window's origin in image and mask
    Plx_Image *gradient;    // the cut window's size
    uint32_t first, count;  // gradient rows
};

// Squared central-difference gradient of one channel; 16-bit squares saturate at the
// largest 32-bit value, so a steep edge never wraps round to a small gradient.
template <class T>
inline GradientOf<T> squared_gradient(T n, T s, T w, T e)
{
    if constexpr (std::is_same_v<T, uint8_t>) {
        const int32_t dy = int32_t(s) - int32_t(n), dx = int32_t(e) - int32_t(w);
        return uint32_t(dy * dy + dx * dx);
    } else if constexpr (std::is_same_v<T, uint16_t>) {
        const int64_t dy = int64_t(s) - int64_t(n), dx = int64_t(e) - int64_t(w);
        return uint32_t(std::min<int64_t>(dy * dy + dx * dx, int64_t(UINT32_MAX)));
    } else if constexpr (std::is_same_v<T, uint32_t>) {
        const double dy = double(s) - double(n), dx = double(e) - double(w);
        return dy * dy + dx * dx;
    } else {
        const float dy = s - n, dx = e - w;
        return dy * dy + dx * dx;
    }
}

template <class T, int CIn, int COut>
void gradient_rows(const GradientJob &job)
{
    using G = GradientOf<T>;
    const int32_t width = job.gradient->width;
    for (uint32_t i = 0; i < job.count; ++i) {
        const int32_t r = int32_t(job.first + i);
        const int32_t ir = r + job.row0;
        const T *up = static_cast<const T *>(plx_image_row(job.image, ir - 1)) + std::ptrdiff_t(job.col0) * CIn;
        const T *mid = static_cast<const T *>(plx_image_row(job.image, ir)) + std::ptrdiff_t(job.col0) * CIn;
        const T *down = static_cast<const T *>(plx_image_row(job.image, ir + 1)) + std::ptrdiff_t(job.col0) * CIn;
        G *out = static_cast<G *>(plx_image_row(job.gradient, r));
        const uint32_t *bits = job.mask != nullptr ? bit_row(job.mask, ir) : nullptr;
        for (int32_t c = 1; c < width - 1; ++c) {
            if (bits != nullptr && !test_bit(bits, c + job.col0)) continue;
            for (int k = 0; k < COut; ++k)
                out[c * COut + k] = squared_gradient<T>(up[c * CIn + k], down[c * CIn + k], mid[(c - 1) * CIn + k],
                                                        mid[(c + 1) * CIn + k]);
        }
    }
}

Plx_Bool gradient_job(void *record)
{
    const GradientJob &job = *static_cast<const GradientJob *>(record);
    const uint32_t cin = plx_image_format_channels(job.image->format);
    const bool grey = cin == 1;
    auto run = [&](auto t) {
        using T = decltype(t);
        if constexpr (std::is_same_v<T, int32_t> || std::is_same_v<T, double>) {
            return;  // refused before any job starts
        } else {
            if (grey) gradient_rows<T, 1, 1>(job);
            else if (cin == 3) gradient_rows<T, 3, 3>(job);
            else gradient_rows<T, 4, 3>(job);
        }
    };
    plx::dispatch_numeric_type(job.image->type, run);
    return 1;
}

struct SelectJob {
    const Plx_Image *gradient;
    double squared_threshold;
    uint32_t sampling;
    Plx_Image *selection;
    uint32_t first, count;
    // Results of the stripe.
    uint32_t selected;
    int32_t r_lo, r_hi, c_lo, c_hi;
};

template <class G, int C>
void select_rows(SelectJob &job)
{
    const int32_t width = job.gradient->width;
    const uint32_t s = job.sampling;
    const int32_t k = s >= 3 ? int32_t(grid_step(s)) : 1;
    for (uint32_t i = 0; i < job.count; ++i) {
        const int32_t r = int32_t(job.first + i);
        uint32_t *bits = bit_row(job.selection, r);
        std::fill(bits, bits + words_of(width), 0u);
        if (s >= 3 && r % k != 0) continue;
        const G *g = static_cast<const G *>(plx_image_row(job.gradient, r));
        const int32_t start = s == 2 ? (r & 1) : 0;
        const int32_t step = s == 2 ? 2 : k;
        for (int32_t c = start; c < width; c += step) {
            double v = 0;
            for (int ch = 0; ch < C; ++ch) v += double(g[c * C + ch]);
            if (v >= job.squared_threshold) {
                set_bit(bits, c);
                ++job.selected;
                job.r_lo = std::min(job.r_lo, r);
                job.r_hi = std::max(job.r_hi, r);
                job.c_lo = std::min(job.c_lo, c);
                job.c_hi = std::max(job.c_hi, c);
            }
        }
    }
}

Plx_Bool select_job(void *record)
{
    SelectJob &job = *static_cast<SelectJob *>(record);
    const bool grey = job.gradient->format == PLX_FORMAT_GREY;
    switch (job.gradient->type) {
    case PLX_TYPE_UINT: grey ? select_rows<uint32_t, 1>(job) : select_rows<uint32_t, 3>(job); break;
    case PLX_TYPE_FLOAT: grey ? select_rows<float, 1>(job) : select_rows<float, 3>(job); break;
    default: grey ? select_rows<double, 1>(job) : select_rows<double, 3>(job); break;
    }
    return 1;
}

// Selection count and bounding-box area of one try.
struct Selection {
    uint32_t count;
    double area;
};

bool select(const Plx_Image *gradient, double squared_threshold, uint64_t sampling, Plx_Image *selection,
            const ThreadHostInterface *host, Selection *out)
{
    uint32_t count = 0;
    Plx_Window bounds{};
    if (!bComputeSelectedPixel(gradient, squared_threshold, uint32_t(std::min<uint64_t>(sampling, UINT32_MAX)),
                               selection, &count, &bounds, host))
        return false;
    *out = Selection{count, double(bounds.width) * double(bounds.height)};
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bComputeSelectedPixel(const Plx_Image *gradient, double squared_threshold, uint32_t sampling,
                                         Plx_Image *selection, uint32_t *count, Plx_Window *bounds,
                                         const ThreadHostInterface *host)
{
    if (gradient == nullptr || selection == nullptr || count == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null gradient, selection or count", 0);
        return 0;
    }
    if (gradient->format != PLX_FORMAT_GREY && gradient->format != PLX_FORMAT_RGB) {
        PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "gradients are grey or RGB", gradient->format);
        return 0;
    }
    if (gradient->type != PLX_TYPE_UINT && gradient->type != PLX_TYPE_FLOAT && gradient->type != PLX_TYPE_DOUBLE) {
        PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "gradients are unsigned int, float or double", gradient->type);
        return 0;
    }
    if (!is_mask_of(selection, gradient->height, gradient->width)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the selection must be a bit image of the gradient's size", 0);
        return 0;
    }
    const uint32_t n = plano::job_count(host);
    plx::HeapPtr<SelectJob> jobs(PLX_ALLOC(SelectJob, n));
    if (!jobs) return 0;
    for (uint32_t i = 0; i < n; ++i) {
        const plano::Band band = plano::band_of(i, n, uint32_t(gradient->height));
        jobs.get()[i] = SelectJob{gradient, squared_threshold, sampling, selection, band.first, band.count, 0,
                                  INT32_MAX, -1, INT32_MAX, -1};
    }
    if (!run_stripes("bComputeSelectedPixel", host, select_job, jobs.get(), n)) return 0;
    uint32_t total = 0;
    int32_t r_lo = INT32_MAX, r_hi = -1, c_lo = INT32_MAX, c_hi = -1;
    for (uint32_t i = 0; i < n; ++i) {
        const SelectJob &j = jobs.get()[i];
        total += j.selected;
        r_lo = std::min(r_lo, j.r_lo);
        r_hi = std::max(r_hi, j.r_hi);
        c_lo = std::min(c_lo, j.c_lo);
        c_hi = std::max(c_hi, j.c_hi);
    }
    *count = total;
    if (bounds != nullptr)
        *bounds = total == 0 ? Plx_Window{0, 0, 0, 0} : Plx_Window{c_lo, r_lo, c_hi - c_lo + 1, r_hi - r_lo + 1};
    return 1;
}

PLANO_API Plx_Bool bTrackComputePixelParameters(const Plx_Image *image, const Plx_Image *mask,
                                                double start_threshold, double threshold_step, uint32_t sampling,
                                                double min_fraction, double area_fraction, double *threshold_out,
                                                uint32_t *sampling_out, Plx_Image *gradient_buffer,
                                                Plx_Image *selection_buffer, const ThreadHostInterface *host)
{
    if (image == nullptr || threshold_out == nullptr || sampling_out == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null image or output", 0);
        return 0;
    }
    if (mask != nullptr && !is_mask_of(mask, image->height, image->width)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the mask must be a bit image of the image's size", 0);
        return 0;
    }
    const bool colour = image->format == PLX_FORMAT_RGB || image->format == PLX_FORMAT_RGBA ||
                        image->format == PLX_FORMAT_BGR || image->format == PLX_FORMAT_BGRA;
    if (image->format != PLX_FORMAT_GREY && !colour) {
        PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "gradients are taken of grey and colour images", image->format);
        return 0;
    }
    Plx_PixelType gradient_type;
    switch (image->type) {
    case PLX_TYPE_UCHAR:
    case PLX_TYPE_USHORT: gradient_type = PLX_TYPE_UINT; break;
    case PLX_TYPE_UINT: gradient_type = PLX_TYPE_DOUBLE; break;
    case PLX_TYPE_FLOAT: gradient_type = PLX_TYPE_FLOAT; break;
    default: PLX_ERR_START(PLX_ERROR_UNSUPPORTED, "unsupported pixel type for gradients", image->type); return 0;
    }
    // Lowering a positive threshold by a step that is not positive would never end.
    if (start_threshold > 0 && !(threshold_step > 0)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "the threshold step must be positive", 0);
        return 0;
    }
    if (gradient_buffer != nullptr && (gradient_buffer == image || gradient_buffer == mask ||
                                       gradient_buffer == selection_buffer)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the gradient buffer must be an image of its own", 0);
        return 0;
    }
    if (selection_buffer != nullptr && (selection_buffer == image || selection_buffer == mask)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the selection buffer must be an image of its own", 0);
        return 0;
    }
    Plx_Window window{0, 0, image->width, image->height};
    double pixels = double(image->width) * double(image->height);
    if (mask != nullptr) {
        if (!plx_image_get_active_subwindow_b(mask, &window)) {
            PLX_ERR_PASS();
            return 0;
        }
        if (window.width == 0 || window.height == 0) {
            *threshold_out = 0;
            *sampling_out = 2;
            return 1;
        }
        pixels = plx_image_bit_count(mask);
    }
    OwnedImage selection, gradient;
    if (!selection.form(selection_buffer, PLX_FORMAT_GREY, PLX_TYPE_BIT, window.height, window.width) ||
        !gradient.form(gradient_buffer, colour ? PLX_FORMAT_RGB : PLX_FORMAT_GREY, gradient_type, window.height,
                       window.width) ||
        !plx_image_fill_zero(gradient.image)) {
        PLX_ERR_PASS();
        return 0;
    }
    if (window.height < 3 || window.width < 3) return 1;

    const uint32_t n = plano::job_count(host);
    plx::HeapPtr<GradientJob> jobs(PLX_ALLOC(GradientJob, n));
    if (!jobs) return 0;
    for (uint32_t i = 0; i < n; ++i) {
        const plano::Band band = plano::band_of(i, n, uint32_t(window.height - 2));
        jobs.get()[i] = GradientJob{image, mask, window.y, window.x, gradient.image, band.first + 1, band.count};
    }
    if (!run_stripes("bTrackComputePixelParameters", host, gradient_job, jobs.get(), n)) return 0;

    const double area_needed = double(window.width) * double(window.height) * area_fraction;
    const double count_needed = pixels * min_fraction;
    auto enough = [&](const Selection &s) { return s.area > area_needed && double(s.count) > count_needed; };
    auto squared = [&](double t) {
        switch (image->type) {
        case PLX_TYPE_UCHAR: return (255.0 * t) * (255.0 * t);
        case PLX_TYPE_USHORT: return std::min((65535.0 * t) * (65535.0 * t), 4294967295.0);
        default: return t * t;
        }
    };
    double t = start_threshold;
    Selection sel{};
    for (; t > 0; t -= threshold_step) {
        if (!select(gradient.image, squared(t), sampling, selection.image, host, &sel)) {
            PLX_ERR_PASS();
            return 0;
        }
        if (enough(sel)) break;
    }
    if (!(t > 0)) {
        *threshold_out = 0;
        *sampling_out = sampling;
        return 1;
    }
    // Thin the sampling while the selection stays large and spread enough. Past a grid step
    // of the image's size a pattern holds at most one pixel, so the search ends there.
    const uint64_t limit = uint64_t(std::max(window.width, window.height) + 1) * uint64_t(std::max(window.width, window.height) + 1);
    uint64_t kept = sampling;
    for (uint64_t s = next_sampling(sampling); s <= limit && s <= UINT32_MAX; s = next_sampling(s)) {
        if (!select(gradient.image, squared(t), s, selection.image, host, &sel)) {
            PLX_ERR_PASS();
            return 0;
        }
        if (!enough(sel)) break;
        kept = s;
    }
    *threshold_out = t;
    *sampling_out = uint32_t(kept);
    return 1;
}

}  // extern "C"
