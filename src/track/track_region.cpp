// Regions of a track: cutting the region's windows out of the frames (its most varied colour
// channel, odd-sized boxes, resampling through lens distortion), the search window sized for
// the rotation and scale sweeps, the homography moved into window pixels, pre-smoothing and
// the three image pyramids.
#include <algorithm>
#include <cfloat>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "common/internal.hpp"
#include "pellux/detail/pixel_traits.hpp"
#include "plano/projective_warp.h"
#include "track/track_object_internal.hpp"

namespace {

bool is_colour(Plx_ImageFormat format)
{
    return format == PLX_FORMAT_RGB || format == PLX_FORMAT_RGBA || format == PLX_FORMAT_BGR ||
           format == PLX_FORMAT_BGRA;
}

bool blue_first(Plx_ImageFormat format)
{
    return format == PLX_FORMAT_BGR || format == PLX_FORMAT_BGRA;
}

// Storage index of channel 1 (red), 2 (green) or 3 (blue) in a colour format.
uint32_t storage_index(Plx_ImageFormat format, uint32_t channel)
{
    return blue_first(format) ? 3 - channel : channel - 1;
}

inline bool bit_at(const Plx_Image *mask, int32_t r, int32_t c)
{
    const auto *row = static_cast<const uint32_t *>(plx_image_row(mask, r));
    return ((row[c >> 5] >> (c & 31)) & 1u) != 0;
}

bool check_mask_for(const Plx_Image *mask, const Plx_Image *image, const char *function)
{
    if (mask == nullptr) return true;
    if (mask->type != PLX_TYPE_BIT || mask->format != PLX_FORMAT_GREY) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "mask is not a bit image", mask->type);
        return false;
    }
    if (mask->width != image->width || mask->height != image->height) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "mask and image differ in size", 0);
        return false;
    }
    return true;
}

bool check_value_image(const Plx_Image *image, const char *function)
{
    if (image == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null image", 0);
        return false;
    }
    if (image->format < PLX_FORMAT_GREY || image->format > PLX_FORMAT_BGRA) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_FORMAT, "image format cannot be tracked", image->format);
        return false;
    }
    if (image->type < PLX_TYPE_UCHAR || image->type > PLX_TYPE_DOUBLE) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "pixel type cannot be tracked", image->type);
        return false;
    }
    return true;
}

// Sums and sums of squares of red, green and blue over the masked pixels of a window.
template <class T>
void accumulate_rgb(const Plx_Image *image, const Plx_Image *mask, Plx_Window w, double sum[3], double sq[3],
                    double *count)
{
    const uint32_t channels = plx_image_format_channels(image->format);
    const uint32_t ir = storage_index(image->format, 1), ig = storage_index(image->format, 2),
                   ib = storage_index(image->format, 3);
    const double to_float = plx::PixelTraits<T>::normalised ? 1.0 / plx::PixelTraits<T>::scale : 1.0;
    double n = 0;
    for (int32_t r = w.y; r < w.y + w.height; ++r) {
        const T *row = static_cast<const T *>(plx_image_row(image, r));
        for (int32_t c = w.x; c < w.x + w.width; ++c) {
            if (mask != nullptr && !bit_at(mask, r, c)) continue;
            const T *p = row + size_t(c) * channels;
            const double v[3] = {double(p[ir]) * to_float, double(p[ig]) * to_float, double(p[ib]) * to_float};
            for (int k = 0; k < 3; ++k) {
                sum[k] += v[k];
                sq[k] += v[k] * v[k];
            }
            n += 1;
        }
    }
    *count = n;
}

// A heap image record with no pixels yet, for a window to be formed into.
Plx_Image *empty_image()
{
    return plx_image_form_gen(nullptr, PLX_FORMAT_GREY, PLX_TYPE_UCHAR, 0, 0);
}

// Copies the bits of src (a window of its own) into dst at (row0, col0).
void copy_bits(const Plx_Image *src, Plx_Image *dst, int32_t row0, int32_t col0)
{
    for (int32_t r = 0; r < src->height; ++r) {
        const auto *s = static_cast<const uint32_t *>(plx_image_row(src, r));
        auto *d = static_cast<uint32_t *>(plx_image_row(dst, row0 + r));
        for (int32_t c = 0; c < src->width; ++c) {
            const int32_t dc = col0 + c;
            const uint32_t bit = 1u << (dc & 31);
            if ((s[c >> 5] >> (c & 31)) & 1u)
                d[dc >> 5] |= bit;
            else
                d[dc >> 5] &= ~bit;
        }
    }
}

// The linear camera with the same matrix as camera: the frame windows are resampled into.
bool linear_version(const Plx_Camera *camera, Plx_Camera *linear)
{
    return plx_camera_build_linear(linear, camera->zh, camera->fx, camera->fy, camera->x0, camera->y0) != 0;
}

// Resamples image (seen by camera) into window (formed, frame offset set, seen by the
// camera's linear version), window's pixels taking their format from window. validity, when
// given, receives which window pixels were sampled (inside the image and its mask).
bool resample_through_camera(const Plx_Image *image, const Plx_Image *mask, const Plx_Camera *camera,
                             Plx_Image *window, Plx_Image *validity)
{
    Plx_Camera linear;
    if (!linear_version(camera, &linear)) return false;
    if (!plx_image_fill_zero(window)) return false;
    // The window itself is the background: it sets the output region and keeps its zeros.
    return bImageProjectiveWarp(window, nullptr, &linear, image, mask, camera, nullptr, nullptr, window, validity,
                                nullptr, nullptr, 0) != 0;
}

// Grows a box (image pixel coordinates) to cover the undistorted positions of its edges.
void grow_through_camera(const Plx_Image *image, const Plx_Camera *camera, Plx_Window *box)
{
    if (camera->point_remove_distortion == nullptr) return;
    double x0 = box->x, y0 = box->y, x1 = box->x + box->width, y1 = box->y + box->height;
    // Barrel and pincushion distortion bend the edges between the corners; sample along them.
    constexpr int kSteps = 8;
    for (int i = 0; i <= kSteps; ++i) {
        const double t = double(i) / kSteps;
        const double px[4] = {box->x + t * box->width, box->x + t * box->width, double(box->x),
                              double(box->x + box->width)};
        const double py[4] = {double(box->y), double(box->y + box->height), box->y + t * box->height,
                              box->y + t * box->height};
        for (int k = 0; k < 4; ++k) {
            const Plx_Vector3 in{px[k] + image->x, py[k] + image->y, camera->zh};
            Plx_Vector3 out;
            int32_t code = 0;
            if (!camera->point_remove_distortion(camera, &in, &out, nullptr, &code) || out.z == 0.0) continue;
            const double u = camera->zh * out.x / out.z - image->x, v = camera->zh * out.y / out.z - image->y;
            if (!std::isfinite(u) || !std::isfinite(v)) continue;
            x0 = std::min(x0, u);
            x1 = std::max(x1, u);
            y0 = std::min(y0, v);
            y1 = std::max(y1, v);
        }
    }
    const int32_t bx0 = int32_t(std::max(0.0, std::floor(x0))), by0 = int32_t(std::max(0.0, std::floor(y0)));
    const int32_t bx1 = int32_t(std::min(double(image->width), std::ceil(x1)));
    const int32_t by1 = int32_t(std::min(double(image->height), std::ceil(y1)));
    *box = Plx_Window{bx0, by0, bx1 - bx0, by1 - by0};
}

// Where the region's images live; every slot is released by vTrackFree or on failure.
enum OwnedSlot {
    kTemplateWindow,
    kTemplateMask,
    kReferenceWindow,
    kReferenceMask,
    kSearchWindow,
    kSearchMask,
    kSmoothedSearch,
    kSmoothedTemplate,
    kSmoothedReference
};

// The region window `box` of `image` (channel: 0 all, else the one extracted) smoothed with
// the image around it, into buffer or a new image. Smoothing the window on its own would
// repeat its edge pixels where the search window sees real surroundings, and the border
// pixels of the two would no longer match. Only the image's own edges are repeated, as for
// the search window. Null with the trace set on failure.
Plx_Image *smooth_in_context(const ThreadHostInterface *host, const Plx_Image *image, Plx_Window box, uint32_t channel,
                             double sigma, Plx_Image *buffer, Plx_Image *scratch)
{
    const int32_t m = int32_t(std::trunc(4.0 * sigma));  // the mask's radius
    const int32_t x0 = std::max(0, box.x - m), y0 = std::max(0, box.y - m);
    const int32_t x1 = int32_t(std::min<int64_t>(image->width, int64_t(box.x) + box.width + m));
    const int32_t y1 = int32_t(std::min<int64_t>(image->height, int64_t(box.y) + box.height + m));
    Plx_Image view{}, grey{}, smoothed{};
    bool ok = plx_image_extract_q(image, Plx_Window{x0, y0, x1 - x0, y1 - y0}, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0,
                                  &view) != nullptr;
    const Plx_Image *source = &view;
    if (ok && channel != 0) {
        ok = plx_image_extract_channel_q(&view, storage_index(image->format, channel), PLX_TYPE_NONE, &grey) !=
             nullptr;
        source = &grey;
    }
    ok = ok && pgiThreadedSmoothImage(host, source, &smoothed, sigma, scratch) != nullptr;
    Plx_Image *out = nullptr;
    if (ok) {
        out = buffer != nullptr ? buffer : empty_image();
        const Plx_Window inner{box.x - x0, box.y - y0, box.width, box.height};
        if (out == nullptr ||
            plx_image_extract_q(&smoothed, inner, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, out) == nullptr) {
            if (out != buffer) plx_image_free(out);
            out = nullptr;
        }
    }
    plx_image_free(&view);
    plx_image_free(&grey);
    plx_image_free(&smoothed);
    if (out == nullptr) PLX_ERR_PASS();
    return out;
}

// A region under construction: released with everything it made unless handed over.
struct RegionBuild {
    TrackRegion *region = nullptr;
    ~RegionBuild() { plano::track::free_region(region); }
};

Plx_ImagePyramid *pyramid_record(TrackRegion *region, Plx_ImagePyramid *storage, int slot)
{
    if (storage != nullptr) return storage;
    auto *p = PLX_ALLOC(Plx_ImagePyramid, 1);
    if (p == nullptr) return nullptr;
    *p = Plx_ImagePyramid{};
    region->owned_pyramids[slot] = p;
    return p;
}

bool valid_settings(double smoothing_sigma, double rotation_range, double scale_range, double rotation_step,
                    double intensity_sigma, const char *function)
{
    const char *what = nullptr;
    if (!(smoothing_sigma >= 0.0) || !std::isfinite(smoothing_sigma))
        what = "smoothing sigma must be 0 or positive";
    else if (!(rotation_range >= 0.0 && rotation_range <= M_PI))
        what = "rotation range must lie in [0, pi]";
    else if (!(scale_range >= 0.0) || !std::isfinite(scale_range))
        what = "scale range must be 0 or positive";
    else if (rotation_range > 0.0 && !(rotation_step > 0.0))
        what = "a rotation sweep needs a positive rotation step";
    else if (!(intensity_sigma > 0.0))
        what = "intensity sigma must be positive";
    if (what == nullptr) return true;
    PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, what, 0);
    return false;
}

// Width and height of the search window, in pixels, around a box of the given size.
bool search_window_size(const Plx_Window &box, const TrackRegionSettings &s, int64_t *width, int64_t *height)
{
    const int64_t sx = s.search_range_x, sy = s.search_range_y;
    if (s.rotation_range == 0.0 && s.scale_range == 0.0) {
        *width = box.width + 2 * sx;
        *height = box.height + 2 * sy;
    } else {
        // The box's footprint at the largest scale, turned by up to the rotation range.
        const double w = (1.0 + s.scale_range) * box.width, h = (1.0 + s.scale_range) * box.height;
        const double d = std::sqrt(w * w + h * h), phi = std::atan2(h, w), r = s.rotation_range;
        const double rw = r < phi ? h * std::fabs(std::sin(r)) + w * std::fabs(std::cos(r)) : d;
        const double rh = r < M_PI / 2 - phi ? w * std::fabs(std::sin(r)) + h * std::fabs(std::cos(r)) : d;
        *width = 2 * (((int64_t(std::llround(rw)) + 1) >> 1) + sx);
        *height = 2 * (((int64_t(std::llround(rh)) + 1) >> 1) + sy);
    }
    return *width <= INT32_MAX / 2 && *height <= INT32_MAX / 2;
}

// Cuts the search window out of the current image: zero where it leaves the image, with a
// valid-pixel mask when it was clipped or a valid mask was given (always through a camera).
bool extract_search_window(const Track *track, TrackRegion *region, const Plx_Image *valid_mask,
                           Plx_Image *window_buffer, int32_t wx, int32_t wy, int32_t ww, int32_t wh,
                           Plx_Image **window_out, Plx_Image **mask_out, const char *function)
{
    const Plx_Image *current = track->current_image;
    const Plx_Window frame{current->x, current->y, current->width, current->height};
    const Plx_Window inside = plx_window_intersect(Plx_Window{wx, wy, ww, wh}, frame);
    if (inside.width <= 0 || inside.height <= 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_NO_DATA, "search window lies wholly outside the current image", 0);
        return false;
    }
    const uint32_t channel = is_colour(current->format) ? region->active_channel : 0;
    const Plx_ImageFormat format = channel != 0 ? PLX_FORMAT_GREY : current->format;
    Plx_Image *window = window_buffer;
    if (window == nullptr) window = region->owned_images[kSearchWindow] = empty_image();
    if (window == nullptr || !plx_image_set_gen(window, format, current->type, wh, ww)) return false;
    window->x = wx;
    window->y = wy;
    *window_out = window;
    const bool clipped = inside.width != ww || inside.height != wh;
    const bool linear = plx_camera_is_linear(&track->current_camera) != 0;
    if (!linear || clipped || valid_mask != nullptr) {
        Plx_Image *mask = region->owned_images[kSearchMask] = plx_image_form_gen_b(nullptr, wh, ww);
        if (mask == nullptr || !plx_image_fill_zero(mask)) return false;
        mask->x = wx;
        mask->y = wy;
        *mask_out = mask;
    }
    if (!linear) {
        // Resampled as a whole: pixels that fall outside the image or its valid mask are left
        // zero and unset in the mask.
        Plx_Image *target = window;
        Plx_Image *colour = nullptr;
        if (channel != 0) {
            colour = plx_image_form_gen(nullptr, current->format, current->type, wh, ww);
            if (colour == nullptr) return false;
            colour->x = wx;
            colour->y = wy;
            target = colour;
        }
        bool ok = resample_through_camera(current, valid_mask, &track->current_camera, target, *mask_out);
        if (ok && colour != nullptr)
            ok = plx_image_extract_channel_q(colour, storage_index(current->format, channel), PLX_TYPE_NONE,
                                             window) != nullptr;
        plx_image_free(colour);
        window->x = wx;
        window->y = wy;
        return ok;
    }
    if (!plx_image_fill_zero(window)) return false;
    const Plx_Window src{inside.x - current->x, inside.y - current->y, inside.width, inside.height};
    const Plx_Window dst{inside.x - wx, inside.y - wy, inside.width, inside.height};
    Plx_Image src_view{}, dst_view{};
    bool ok = plx_image_extract_q(current, src, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &src_view) != nullptr &&
              plx_image_extract_q(window, dst, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &dst_view) != nullptr;
    if (ok)
        ok = channel != 0 ? plx_image_extract_channel_q(&src_view, storage_index(current->format, channel),
                                                        PLX_TYPE_NONE, &dst_view) != nullptr
                          : plx_image_convert_q(&src_view, PLX_FORMAT_NONE, PLX_TYPE_NONE, &dst_view) != nullptr;
    plx_image_free(&src_view);
    plx_image_free(&dst_view);
    if (!ok || *mask_out == nullptr) return ok;
    if (valid_mask == nullptr) {
        const double one = 1.0;
        return plx_image_fill_const_window(*mask_out, dst, &one) != 0;
    }
    Plx_Image *bits = plx_image_extract_q(valid_mask, src, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, nullptr);
    if (bits == nullptr) return false;
    copy_bits(bits, *mask_out, dst.y, dst.x);
    plx_image_free(bits);
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bComputeActiveChannel(const Plx_Image *image, const Plx_Image *mask, int32_t row0, int32_t col0,
                                         uint32_t height, uint32_t width, uint32_t *channel)
{
    if (image == nullptr || channel == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return 0;
    }
    if (!is_colour(image->format)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "not a colour image", image->format);
        return 0;
    }
    if (!check_value_image(image, __func__) || !check_mask_for(mask, image, __func__)) return 0;
    if (row0 < 0 || col0 < 0 || int64_t(row0) + height > image->height || int64_t(col0) + width > image->width) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "window outside the image", 0);
        return 0;
    }
    double sum[3] = {0, 0, 0}, sq[3] = {0, 0, 0}, count = 0;
    const Plx_Window w{col0, row0, int32_t(width), int32_t(height)};
    plx::dispatch_numeric_type(image->type, [&](auto t) {
        accumulate_rgb<decltype(t)>(image, mask, w, sum, sq, &count);
    });
    if (count == 0) {
        *channel = 2;
        return 1;
    }
    double var[3];
    for (int k = 0; k < 3; ++k) var[k] = sq[k] - sum[k] * sum[k] / count;
    if (var[1] >= var[0] && var[1] >= var[2])
        *channel = 2;
    else if (var[2] >= var[0])
        *channel = 3;
    else
        *channel = 1;
    return 1;
}

PLANO_API Plx_Bool bExtractRegion(const Plx_Image *image, const Plx_Image *mask, const Plx_Camera *camera,
                                  uint32_t extract_active_channel, uint32_t *channel, Plx_Image *window,
                                  Plx_Image *window_mask, Plx_Window *box)
{
    if (window == nullptr || window_mask == nullptr || box == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return 0;
    }
    if (!check_value_image(image, __func__) || !check_mask_for(mask, image, __func__)) return 0;
    if (channel != nullptr && *channel > 3) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "channel must be 0 to 3", *channel);
        return 0;
    }
    Plx_Window b{0, 0, image->width, image->height};
    if (mask != nullptr && !plx_image_get_active_subwindow_b(mask, &b)) {
        PLX_ERR_PASS();
        return 0;
    }
    if (b.width <= 0 || b.height <= 0) {
        PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "empty region", 0);
        return 0;
    }
    const bool distorted = camera != nullptr && plx_camera_is_linear(camera) == 0;
    if (distorted) grow_through_camera(image, camera, &b);
    // An odd size gives the region a centre pixel.
    if (b.width % 2 == 0) {
        if (b.x + b.width < image->width)
            ++b.width;
        else if (b.x > 0)
            --b.x, ++b.width;
    }
    if (b.height % 2 == 0) {
        if (b.y + b.height < image->height)
            ++b.height;
        else if (b.y > 0)
            --b.y, ++b.height;
    }
    uint32_t ch = 0;
    if (extract_active_channel != 0 && is_colour(image->format)) {
        ch = channel != nullptr ? *channel : 0;
        if (ch == 0 && !bComputeActiveChannel(image, mask, b.y, b.x, uint32_t(b.height), uint32_t(b.width), &ch)) {
            PLX_ERR_PASS();
            return 0;
        }
    }
    const int32_t fx = image->x + b.x, fy = image->y + b.y;
    bool ok = true;
    if (distorted) {
        Plx_Image *colour = nullptr;
        Plx_Image *target = window;
        if (ch != 0) {
            colour = target = plx_image_form_gen(nullptr, image->format, image->type, b.height, b.width);
            ok = colour != nullptr;
        } else {
            ok = plx_image_set_gen(window, image->format, image->type, b.height, b.width) != 0;
        }
        ok = ok && plx_image_set_gen(window_mask, PLX_FORMAT_GREY, PLX_TYPE_BIT, b.height, b.width) != 0;
        if (ok) {
            target->x = window_mask->x = fx;
            target->y = window_mask->y = fy;
            ok = resample_through_camera(image, mask, camera, target, window_mask);
        }
        if (ok && colour != nullptr)
            ok = plx_image_extract_channel_q(colour, storage_index(image->format, ch), PLX_TYPE_NONE, window) !=
                 nullptr;
        plx_image_free(colour);
    } else {
        if (ch != 0) {
            Plx_Image view{};
            ok = plx_image_extract_q(image, b, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &view) != nullptr &&
                 plx_image_extract_channel_q(&view, storage_index(image->format, ch), PLX_TYPE_NONE, window) !=
                     nullptr;
            plx_image_free(&view);
        } else {
            ok = plx_image_extract_q(image, b, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, window) != nullptr;
        }
        if (ok && mask != nullptr) {
            ok = plx_image_extract_q(mask, b, PLX_FORMAT_NONE, PLX_TYPE_NONE, 1, window_mask) != nullptr;
        } else if (ok) {
            const double one = 1.0;
            ok = plx_image_set_gen(window_mask, PLX_FORMAT_GREY, PLX_TYPE_BIT, b.height, b.width) != 0 &&
                 plx_image_fill_const(window_mask, &one) != 0;
        }
    }
    if (!ok) {
        PLX_ERR_PASS();
        return 0;
    }
    window->x = window_mask->x = fx;
    window->y = window_mask->y = fy;
    if (channel != nullptr) *channel = ch;
    *box = b;
    return 1;
}

PLANO_API TrackRegion *pTrackRegion(
    Track *track, Plx_Image *previous_mask, Plx_Image *reference_image, const Plx_Camera *reference_camera,
    Plx_Image *reference_mask, Plx_Image *current_valid_mask, const Plx_Matrix33 *homography,
    const Plx_SquMatrix *information, const double *intensity_model, double smoothing_sigma,
    uint32_t correlation_size, double rotation_range, double scale_range, double rotation_step,
    uint32_t search_range_y, uint32_t search_range_x, uint32_t motion_model, double min_overlap,
    double texture_threshold, double min_corr_score, uint32_t min_pixel_count, double peak_sharpness,
    uint32_t smoothing_passes, double max_rejected_fraction, uint32_t pixel_sampling, double motion_prior_scale,
    uint32_t block_size, double intensity_sigma, double robust_scale, double outlier_cutoff,
    Plx_Image *correlation_buffer, Plx_Image *template_buffer, Plx_Image *window_buffer,
    Plx_Image *smoothed_window_buffer, Plx_Image *smoothed_template_buffer, Plx_Image *smoothing_scratch,
    Plx_ImagePyramid *search_pyramid_storage, Plx_ImagePyramid *template_pyramid_storage,
    Plx_ImagePyramid *reference_pyramid_storage, const ThreadHostInterface *host)
{
    // ---- checks: nothing is made or touched before the arguments are known to be usable ----
    if (track == nullptr || track->regions == nullptr || track->previous_image == nullptr ||
        track->current_image == nullptr || reference_image == nullptr || reference_camera == nullptr ||
        homography == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return nullptr;
    }
    if (!valid_settings(smoothing_sigma, rotation_range, scale_range, rotation_step, intensity_sigma, __func__))
        return nullptr;
    const uint32_t n = plano::track::model_parameter_count(motion_model);
    if (n == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown motion model", motion_model);
        return nullptr;
    }
    if (information != nullptr && information->size != n) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "information matrix does not fit the motion model", information->size);
        return nullptr;
    }
    if (!check_value_image(track->current_image, __func__) ||
        !check_mask_for(current_valid_mask, track->current_image, __func__))
        return nullptr;

    RegionBuild build;
    TrackRegion *region = build.region = PLX_ALLOC(TrackRegion, 1);
    if (region == nullptr) return nullptr;
    std::memset(static_cast<void *>(region), 0, sizeof *region);
    region->camera = *reference_camera;
    region->settings = TrackRegionSettings{smoothing_sigma,       correlation_size,  rotation_range,
                                           scale_range,           rotation_step,     search_range_y,
                                           search_range_x,        motion_model,      min_overlap,
                                           texture_threshold,     min_corr_score,    min_pixel_count,
                                           peak_sharpness,        smoothing_passes,  max_rejected_fraction,
                                           pixel_sampling,        motion_prior_scale, block_size,
                                           intensity_sigma,       robust_scale,      outlier_cutoff};
    region->homography = *homography;
    plx_vec_form_data(&region->homography_vector, 9, &region->homography.m[0][0]);
    region->gain = intensity_model != nullptr ? intensity_model[0] : 1.0;
    region->offset = intensity_model != nullptr ? intensity_model[1] : 0.0;
    region->levels = track->levels;
    region->status = TRACK_REGION_OK;
    region->corr_score = DBL_MAX;
    region->rms_residual = DBL_MAX;
    region->rejected_fraction = 0.0;
    region->boundary_distance_weighting = 1;
    region->correlation_buffer = correlation_buffer;
    region->template_buffer = template_buffer;
    region->information = plx_squmat_new(PLX_SQUMAT_SYMMETRIC, n);
    if (region->information == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    if (information != nullptr) {
        double values[81];
        for (uint32_t i = 0; i < n; ++i)
            for (uint32_t j = 0; j < n; ++j) values[i * n + j] = plx_squmat_get(information, i, j);
        if (!plx_squmat_fill(region->information, values)) {
            PLX_ERR_PASS();
            return nullptr;
        }
        region->information_given = 1;
    } else if (!plx_squmat_fill_zero(region->information)) {
        PLX_ERR_PASS();
        return nullptr;
    }

    // ---- the template from the previous image, the reference window when it differs ----
    Plx_Image *const previous = track->previous_image;
    Plx_Image *const current = track->current_image;
    Plx_Image *tw = region->owned_images[kTemplateWindow] = empty_image();
    Plx_Image *tm = region->owned_images[kTemplateMask] = empty_image();
    if (tw == nullptr || tm == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    uint32_t channel = 0;
    Plx_Window tbox;
    if (!bExtractRegion(previous, previous_mask, &track->previous_camera, track->extract_active_channel, &channel,
                        tw, tm, &tbox)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    region->active_channel = channel;
    region->region_origin[0] = tw->x;
    region->region_origin[1] = tw->y;
    const bool shared_reference = reference_image == previous;
    const bool shared_search = previous == current;
    Plx_Image *rw = tw, *rm = tm;
    uint32_t reference_channel = channel;
    Plx_Window rbox = tbox;
    if (shared_reference) {
        region->template_origin[0] = region->region_origin[0];
        region->template_origin[1] = region->region_origin[1];
        region->template_position[0] = uint32_t(tbox.x);
        region->template_position[1] = uint32_t(tbox.y);
    } else {
        rw = region->owned_images[kReferenceWindow] = empty_image();
        rm = region->owned_images[kReferenceMask] = empty_image();
        if (rw == nullptr || rm == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
        // The reference window is cut from the template's channel, so all windows compare.
        reference_channel = channel;
        if (!bExtractRegion(reference_image, reference_mask, reference_camera, channel != 0 ? 1u : 0u,
                            &reference_channel, rw, rm, &rbox)) {
            PLX_ERR_PASS();
            return nullptr;
        }
        region->template_origin[0] = rw->x;
        region->template_origin[1] = rw->y;
        region->template_position[0] = uint32_t(rbox.x);
        region->template_position[1] = uint32_t(rbox.y);
    }

    // ---- the search window in the current image ----
    Plx_Image *sw = nullptr, *sm = nullptr;
    if (shared_search) {
        // One frame against itself: the region's own window serves as the search window, so
        // its mask and geometry stay those of the region.
        region->search_origin[0] = region->region_origin[0];
        region->search_origin[1] = region->region_origin[1];
    } else {
        int64_t ww, wh;
        if (!search_window_size(tbox, region->settings, &ww, &wh)) {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "search window too large", 0);
            return nullptr;
        }
        const int64_t cx = int64_t(tw->x) + (tbox.width >> 1), cy = int64_t(tw->y) + (tbox.height >> 1);
        const int64_t wx = cx - ww / 2, wy = cy - wh / 2;
        if (wx < INT32_MIN / 2 || wy < INT32_MIN / 2 || wx + ww > INT32_MAX / 2 || wy + wh > INT32_MAX / 2) {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "search window too large", 0);
            return nullptr;
        }
        if (!extract_search_window(track, region, current_valid_mask, window_buffer, int32_t(wx), int32_t(wy),
                                   int32_t(ww), int32_t(wh), &sw, &sm, __func__)) {
            PLX_ERR_PASS();
            return nullptr;
        }
        region->search_origin[0] = double(wx);
        region->search_origin[1] = double(wy);
    }

    // ---- the homography in window pixels ----
    if (!plano::track::region_to_window_pixels(track, region, __func__)) {
        PLX_ERR_PASS();
        return nullptr;
    }

    // ---- pre-smoothing ----
    Plx_Image *t0 = tw, *r0 = rw, *s0 = sw;
    if (smoothing_sigma > 0.0) {
        // Region windows cut straight from their image are smoothed with the image around
        // them (the search window reaches past the pixels the template maps to); windows
        // resampled through a camera have no such surroundings and are smoothed alone.
        t0 = plx_camera_is_linear(&track->previous_camera)
                 ? smooth_in_context(host, previous, tbox, channel, smoothing_sigma, smoothed_template_buffer,
                                     smoothing_scratch)
                 : pgiThreadedSmoothImage(host, tw, smoothed_template_buffer, smoothing_sigma, smoothing_scratch);
        if (t0 != nullptr && smoothed_template_buffer == nullptr) region->owned_images[kSmoothedTemplate] = t0;
        if (t0 == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
        if (shared_reference) {
            r0 = t0;
        } else {
            r0 = region->owned_images[kSmoothedReference] =
                plx_camera_is_linear(reference_camera)
                    ? smooth_in_context(host, reference_image, rbox, reference_channel, smoothing_sigma, nullptr,
                                        smoothing_scratch)
                    : pgiThreadedSmoothImage(host, rw, nullptr, smoothing_sigma, smoothing_scratch);
            if (r0 == nullptr) {
                PLX_ERR_PASS();
                return nullptr;
            }
        }
        if (sw != nullptr) {
            s0 = pgiThreadedSmoothImage(host, sw, smoothed_window_buffer, smoothing_sigma, smoothing_scratch);
            if (s0 != nullptr && smoothed_window_buffer == nullptr) region->owned_images[kSmoothedSearch] = s0;
            if (s0 == nullptr) {
                PLX_ERR_PASS();
                return nullptr;
            }
        }
        // Smoothed windows sit where their windows sit in the frame.
        const std::pair<Plx_Image *, const Plx_Image *> placed[3] = {{t0, tw}, {r0, rw}, {s0, sw}};
        for (const auto &[smoothed, source] : placed)
            if (smoothed != nullptr) {
                smoothed->x = source->x;
                smoothed->y = source->y;
            }
    }

    // ---- the pyramids ----
    const uint32_t levels = track->levels;
    region->template_pyramid = pyramid_record(region, template_pyramid_storage, 1);
    if (region->template_pyramid == nullptr) return nullptr;
    if (!plx_image_pyramid_build_preallocated(region->template_pyramid, t0, tm, levels)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    if (shared_reference) {
        region->reference_pyramid = region->template_pyramid;
    } else {
        region->reference_pyramid = pyramid_record(region, reference_pyramid_storage, 2);
        if (region->reference_pyramid == nullptr) return nullptr;
        if (!plx_image_pyramid_build_preallocated(region->reference_pyramid, r0, rm, levels)) {
            PLX_ERR_PASS();
            return nullptr;
        }
    }
    if (shared_search) {
        region->search_pyramid = region->template_pyramid;
    } else {
        region->search_pyramid = pyramid_record(region, search_pyramid_storage, 0);
        if (region->search_pyramid == nullptr) return nullptr;
        if (!plx_image_pyramid_build_preallocated(region->search_pyramid, s0, sm, levels)) {
            PLX_ERR_PASS();
            return nullptr;
        }
    }

    if (!plx_list_insert_first(track->regions, region)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    build.region = nullptr;
    return region;
}

}  // extern "C"
