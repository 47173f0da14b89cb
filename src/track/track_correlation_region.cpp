// The coarse search of one region: a visibility test, or a correlation at a coarse level,
// plain or over a sweep of rotations and scales, that moves the region's homography.
//
// The region's homography is held in window pixels (reference window to search window),
// so the warps here run between views of the windows placed at the origin, with identity
// cameras.
#include <algorithm>
#include <cmath>

#include "plano/projective_warp.h"
#include "plano/track_correlation.h"
#include "track/track_pixels_internal.hpp"

namespace {

using namespace plano::track;

// A view of an image's pixels with its frame offset dropped (never freed).
Plx_Image at_origin(const Plx_Image *image)
{
    Plx_Image view = *image;
    view.x = view.y = 0;
    view.block = nullptr;
    view.block_size = 0;
    view.owned = 0;
    view.free_func = nullptr;
    return view;
}

bool interrupted(const ThreadHostInterface *host)
{
    return host != nullptr && host->interrupt != nullptr && host->interrupt(host->callback_context) != 0;
}

void advance(StatusTime *status_time, double share, const ThreadHostInterface *host)
{
    if (status_time != nullptr)
        vStatusTimeIncrement(status_time, share, host != nullptr ? host->progress : nullptr,
                             host != nullptr ? host->callback_context : nullptr);
}

// Fails the region with a status, adding this function's code-1 record.
bool fail(TrackRegion *region, TrackRegionStatus status, const char *message)
{
    region->status = status;
    plx_err_register_fileline("bTrackRegionOptimise", PLX_ERROR_CALLEE, __FILE__, __LINE__, message, 0);
    return false;
}

// One correlation and its peak. best receives the accepted peak score (or stays -1).
struct Peak {
    double best = -1;
    int32_t row = 0, col = 0;
};

struct Context {
    const Track *track;
    TrackRegion *region;
    StatusTime *status_time;
    const ThreadHostInterface *host;
    Plx_Image *scratch;
};

// Correlates template (with its mask, weighted by its distance map when the region asks)
// against the search level; false on failure (status 2 set). Sets *stop on an interrupt.
bool correlate_level(Context &ctx, const Plx_Image *tpl, const Plx_Image *tpl_mask, const Plx_Image *search,
                     const Plx_Image *search_mask, double share, Peak *peak, bool *stop)
{
    TrackRegion *region = ctx.region;
    const TrackRegionSettings &s = region->settings;
    const Plx_Image *weight = tpl_mask;
    if (region->boundary_distance_weighting && tpl_mask != nullptr) {
        if (!bImageChamferMap(tpl_mask, ctx.scratch)) return fail(region, TRACK_REGION_NO_MATCH, "distance map failed");
        weight = ctx.scratch;
    }
    const ThreadHostInterface *host = ctx.host;
    Plx_Image *buffer = region->correlation_buffer;
    Plx_Image *result =
        host != nullptr && host->correlation != nullptr
            ? host->correlation(host, tpl, weight, search, search_mask, s.texture_threshold, buffer, ctx.status_time,
                                share)
            : pgiTrackImageCorrelate2D_q(host, tpl, weight, search, search_mask, s.texture_threshold, buffer,
                                         ctx.status_time, share);
    if (result == nullptr) return fail(region, TRACK_REGION_NO_MATCH, "correlation failed");
    bool ok = true;
    peak->best = -1;
    if (interrupted(host)) {
        *stop = true;
    } else if (!bGetBestCorrScore(result, s.min_overlap, s.min_corr_score, s.peak_sharpness, &peak->row, &peak->col,
                                  &peak->best)) {
        ok = fail(region, TRACK_REGION_NO_MATCH, "peak search failed");
    }
    if (result != buffer) plx_image_free(result);
    return ok;
}

// Visibility only: the fraction of the reference mask that the search window's valid mask
// still covers through the homography.
bool visibility(Context &ctx, double time_share, uint32_t few_regions)
{
    TrackRegion *region = ctx.region;
    const Plx_PyramidLevel &search0 = region->search_pyramid->level[0];
    const Plx_PyramidLevel &ref0 = region->reference_pyramid->level[0];
    if (search0.mask != nullptr && ref0.mask != nullptr) {
        OwnedImage seen;
        if (!seen.form(nullptr, PLX_FORMAT_GREY, PLX_TYPE_BIT, ref0.mask->height, ref0.mask->width) ||
            !plx_image_fill_zero(seen.image))
            return fail(region, TRACK_REGION_LOST, "visibility mask failed");
        const Plx_Image source = at_origin(search0.mask);
        const Plx_Image reference = at_origin(ref0.mask);
        if (!bImageProjectiveWarp(seen.image, nullptr, nullptr, &source, nullptr, nullptr, &region->homography,
                                  nullptr, seen.image, nullptr, nullptr, nullptr, 0) ||
            !plx_image_bit_and_q(seen.image, &reference, seen.image))
            return fail(region, TRACK_REGION_OUT_OF_VIEW, "visibility warp failed");
        const double visible = plx_image_bit_count(seen.image);
        if (visible < double(plx_image_bit_count(&reference)) * region->settings.min_overlap)
            region->status = TRACK_REGION_OUT_OF_VIEW;
    }
    if (few_regions && ctx.host != nullptr) advance(ctx.status_time, time_share, ctx.host);
    return true;
}

// Translation T(x / zh, y / zh) applied after H.
void translate(Plx_Matrix33 *h, double x, double y)
{
    for (int j = 0; j < 3; ++j) {
        h->m[0][j] += x * h->m[2][j];
        h->m[1][j] += y * h->m[2][j];
    }
}

bool plain_search(Context &ctx, uint32_t level, double time_share, bool *stop)
{
    TrackRegion *region = ctx.region;
    const Plx_PyramidLevel &t = region->template_pyramid->level[level];
    const Plx_PyramidLevel &sr = region->search_pyramid->level[level];
    Peak peak;
    if (!correlate_level(ctx, t.image, t.mask, sr.image, sr.mask, time_share, &peak, stop)) return false;
    if (*stop) return true;
    if (peak.best > 0) {
        const double zh = ctx.track->current_camera.zh;
        const double x = double(int64_t(peak.col) << level) - double(region->settings.search_range_x);
        const double y = double(int64_t(peak.row) << level) - double(region->settings.search_range_y);
        region->corr_offset[0] = x;
        region->corr_offset[1] = y;
        translate(&region->homography, x / zh, y / zh);
        region->corr_score = peak.best;
    } else {
        region->status = TRACK_REGION_NO_MATCH;
    }
    return true;
}

struct Sweep {
    uint32_t rotations, scales;
    double angle_step, scale_step;
};

bool sweep_search(Context &ctx, uint32_t level, uint32_t sweep_level, const Sweep &sw, double time_share,
                  bool *stop)
{
    TrackRegion *region = ctx.region;
    const TrackRegionSettings &s = region->settings;
    region->status = TRACK_REGION_LOST;
    const Plx_PyramidLevel &t = region->template_pyramid->level[sweep_level];
    const Plx_PyramidLevel &search0 = region->search_pyramid->level[0];
    const Plx_PyramidLevel &sr = region->search_pyramid->level[level];
    const int64_t ww = (int64_t(search0.image->width) - 2 * int64_t(s.search_range_x)) >> sweep_level;
    const int64_t wh = (int64_t(search0.image->height) - 2 * int64_t(s.search_range_y)) >> sweep_level;
    if (ww < 1 || wh < 1) return fail(region, TRACK_REGION_LOST, "search window too small for the sweep");
    OwnedImage work, work_mask;
    if (!work.form(region->template_buffer, t.image->format, t.image->type, int32_t(wh), int32_t(ww)) ||
        !work_mask.form(nullptr, PLX_FORMAT_GREY, PLX_TYPE_BIT, int32_t(wh), int32_t(ww)))
        return fail(region, TRACK_REGION_LOST, "work image failed");
    work.image->x = work.image->y = 0;
    const Plx_Image source = at_origin(t.image);
    Plx_Image source_mask_view{};
    if (t.mask != nullptr) source_mask_view = at_origin(t.mask);
    const Plx_Image *source_mask = t.mask != nullptr ? &source_mask_view : nullptr;
    const double cx = t.image->width / 2.0, cy = t.image->height / 2.0;
    const double cxw = double(ww) / 2.0, cyw = double(wh) / 2.0;
    const double share = time_share / (double(2 * sw.scales + 1) * double(2 * sw.rotations + 1));
    const double one = 1.0;
    Peak best;
    Plx_Matrix33 best_m{};
    Plx_ImagePyramid pyramid{};
    struct PyramidGuard {
        Plx_ImagePyramid *p;
        ~PyramidGuard() { plx_image_pyramid_free(p); }
    } guard{&pyramid};
    for (int64_t i = -int64_t(sw.scales); i <= int64_t(sw.scales) && !*stop; ++i) {
        if (interrupted(ctx.host)) {
            *stop = true;
            break;
        }
        double f = 1.0 + double(i < 0 ? -i : i) * sw.scale_step;
        if (i < 0) f = 1.0 / f;
        for (int64_t j = -int64_t(sw.rotations); j <= int64_t(sw.rotations); ++j) {
            if (interrupted(ctx.host)) {
                *stop = true;
                break;
            }
            const double a = double(j) * sw.angle_step, ca = std::cos(a), sa = std::sin(a);
            const Plx_Matrix33 m{{{f * ca, -f * sa, cx - f * (ca * cxw - sa * cyw)},
                                  {f * sa, f * ca, cy - f * (sa * cxw + ca * cyw)},
                                  {0, 0, 1}}};
            if (!plx_image_fill_zero(work.image) || !plx_image_fill_const(work_mask.image, &one) ||
                !bImageProjectiveWarp(work.image, nullptr, nullptr, &source, source_mask, nullptr, &m, nullptr,
                                      work.image, work_mask.image, nullptr, nullptr, 0))
                return fail(region, TRACK_REGION_LOST, "warping the template failed");
            const Plx_Image *tpl = work.image, *tpl_mask = work_mask.image;
            if (sweep_level != level) {
                if (!plx_image_pyramid_build_preallocated(&pyramid, work.image, work_mask.image, 2))
                    return fail(region, TRACK_REGION_PYRAMID_FAILED, "the work pyramid failed");
                tpl = pyramid.level[1].image;
                tpl_mask = pyramid.level[1].mask;
            }
            Peak peak;
            if (!correlate_level(ctx, tpl, tpl_mask, sr.image, sr.mask, share, &peak, stop)) return false;
            if (*stop) break;
            if (peak.best > best.best) {
                best = peak;
                best_m = m;
            }
        }
    }
    if (*stop || !(best.best > 0)) return true;
    Plx_Matrix33 h;
    if (!plx_mat33_invert_s(&best_m, &h)) return fail(region, TRACK_REGION_LOST, "singular sweep similarity");
    const double zh = ctx.track->current_camera.zh;
    const double ox = double(int64_t(best.col) << level), oy = double(int64_t(best.row) << level);
    h.m[0][2] = (std::ldexp(h.m[0][2], int(sweep_level)) + ox) / zh;
    h.m[1][2] = (std::ldexp(h.m[1][2], int(sweep_level)) + oy) / zh;
    region->homography = h;
    region->corr_offset[0] = ox;
    region->corr_offset[1] = oy;
    region->corr_score = best.best;
    region->status = TRACK_REGION_OK;
    return true;
}

bool region_optimise(Context &ctx, double time_share, uint32_t few_regions)
{
    TrackRegion *region = ctx.region;
    const TrackRegionSettings &s = region->settings;
    if (s.correlation_size == TRACK_NO_CORRELATION) return visibility(ctx, time_share, few_regions);

    // The level where the template is about the correlation size across.
    const uint32_t levels = std::min({region->levels, region->template_pyramid->no_levels,
                                      region->search_pyramid->no_levels});
    const Plx_Image *t0 = region->template_pyramid->level[0].image;
    const uint64_t size = uint64_t(std::floor(std::sqrt(double(t0->width) * double(t0->height))));
    uint32_t level = levels - 1;
    for (uint32_t k = 1; k < levels; ++k)
        if ((size >> k) <= s.correlation_size) {
            level = k - 1;
            break;
        }
    const uint32_t sweep_level = level > 0 ? level - 1 : 0;

    Sweep sw{0, 0, 0, 0};
    const Plx_Image *ts = region->template_pyramid->level[sweep_level].image;
    const double diagonal = std::hypot(double(ts->width), double(ts->height));
    if (s.rotation_range > 0 && diagonal > 0) {
        if (!(s.rotation_step > 0)) {
            region->status = TRACK_REGION_LOST;
            PLX_ERR_START_AS("bTrackRegionOptimise", PLX_ERROR_ILLEGAL_ARGUMENT, "the rotation step must be positive", 0);
            return false;
        }
        const double count = std::floor(s.rotation_range * diagonal / 2.0 / s.rotation_step + 0.5);
        if (count > 1e6) {
            region->status = TRACK_REGION_LOST;
            PLX_ERR_START_AS("bTrackRegionOptimise", PLX_ERROR_ILLEGAL_ARGUMENT, "the rotation step is too small", 0);
            return false;
        }
        sw.rotations = uint32_t(count);
        if (sw.rotations > 0) sw.angle_step = s.rotation_range / sw.rotations;
    }
    if (s.scale_range > 0) {
        const double count = std::floor(s.scale_range / 0.02 + 0.5);
        sw.scales = uint32_t(std::min(count, 1e6));
        if (sw.scales > 0) sw.scale_step = s.scale_range / sw.scales;
    }
    bool stop = false;
    const bool ok = sw.rotations == 0 && sw.scales == 0 ? plain_search(ctx, level, time_share, &stop)
                                                        : sweep_search(ctx, level, sweep_level, sw, time_share, &stop);
    if (!ok) return false;
    if (!stop && !bCorrectHomography(s.motion_model, &region->homography, nullptr))
        return fail(region, TRACK_REGION_LOST, "correcting the homography failed");
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bTrackRegionOptimise(Track *track, TrackRegion *region, StatusTime *status_time,
                                        double time_share, uint32_t few_regions, const ThreadHostInterface *host)
{
    if (track == nullptr || region == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null track or region", 0);
        return 0;
    }
    if (region->template_pyramid == nullptr || region->search_pyramid == nullptr ||
        region->reference_pyramid == nullptr || region->template_pyramid->no_levels == 0 ||
        region->search_pyramid->no_levels == 0 || region->reference_pyramid->no_levels == 0) {
        region->status = TRACK_REGION_PYRAMID_FAILED;
        PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "the region has no pyramids", 0);
        return 0;
    }
    OwnedImage scratch;
    if (track->distance_scratch != nullptr) {
        scratch.image = track->distance_scratch;
    } else if (!scratch.form(nullptr, PLX_FORMAT_GREY, PLX_TYPE_USHORT, 0, 0)) {
        region->status = TRACK_REGION_LOST;
        PLX_ERR_PASS();
        return 0;
    }
    Context ctx{track, region, status_time, host, scratch.image};
    try {
        return region_optimise(ctx, time_share, few_regions) ? 1 : 0;
    } catch (...) {
        region->status = TRACK_REGION_LOST;
        PLX_ERR_START(PLX_ERROR_CALLEE, "the coarse search failed", 0);
        return 0;
    }
}

}  // extern "C"
