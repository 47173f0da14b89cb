// The joint homography optimisation of a Track, one pyramid level at a time: per region a
// homography state with its illumination state, priors and pixel-match block observations;
// constraint points and angles across regions; Levenberg-Marquardt iterations; and at the
// termination level the statistics each region reports (information, observation mask, RMS
// residual, rejected fraction, status) and the estimated constraint targets.
#include <algorithm>
#include <cfloat>
#include <cmath>
#include <cstring>
#include <new>

#include "pellux/detail/util.hpp"
#include "plano/track_homography.h"
#include "plano/track_pixels.h"

namespace {

// What bMatchImages keeps for one region during a level.
struct RegionWork {
    TrackRegion *region = nullptr;
    const Plx_Image *ref_level_image = nullptr;
    Plx_Image *ref_pixels = nullptr;
    Plx_Image *search_pixels = nullptr;
    bool ref_owned = false, search_owned = false;
    Plx_Image gradient_x{}, gradient_y{};  // of the search pixels
    SumoStateVector *homography_state = nullptr;
    SumoStateVector *illumination_state = nullptr;
    TrackPixelObsJob job{};
    Plx_Matrix33 start{};  // the homography at the start of the level
};

// Everything a level builds; released in the right order on every path. Sumo records come
// from the memory stack, so the optimiser goes before the stack.
struct LevelModel {
    Track *track;
    const ThreadHostInterface *host;
    Plx_MemoryStack ms{};
    bool ms_formed = false;
    SumoWorkspace *ws = nullptr;
    Sumo *sumo = nullptr;
    RegionWork *regions = nullptr;
    uint32_t no_regions = 0;

    LevelModel(Track *t, const ThreadHostInterface *h) : track(t), host(h) {}
    LevelModel(const LevelModel &) = delete;
    LevelModel &operator=(const LevelModel &) = delete;
    ~LevelModel()
    {
        for (uint32_t i = 0; i < no_regions; ++i) {
            RegionWork &r = regions[i];
            if (r.region) r.region->state = nullptr;
            if (r.ref_owned) plx_image_free(r.ref_pixels);
            if (r.search_owned) plx_image_free(r.search_pixels);
            plx_image_free(&r.gradient_x);
            plx_image_free(&r.gradient_y);
        }
        if (track->constraint_points)
            for (Plx_ListNode *n = track->constraint_points->head; n; n = n->next)
                static_cast<TrackConstraintPoint *>(n->data)->target_state = nullptr;
        if (sumo) vSumoFree(sumo, host);
        if (ws) vSumoWorkspaceFree(ws);
        if (ms_formed) plx_memory_stack_free(&ms);
        std::free(regions);
    }
    void restore_homographies()
    {
        for (uint32_t i = 0; i < no_regions; ++i)
            if (regions[i].region) regions[i].region->homography = regions[i].start;
    }
};

bool interrupted(const ThreadHostInterface *host)
{
    return host && host->interrupt && host->interrupt(host->callback_context) != 0;
}

bool is_pixel_match(SumoHFunction f)
{
    return f == bPixelMatchAffineH || f == bPixelMatchProjH || f == bPixelMatchTranslateH ||
           f == bPixelMatchTransRotScaleH || f == bPixelMatchTransScaleH || f == bPixelMatchAffineRGBH ||
           f == bPixelMatchProjRGBH || f == bPixelMatchTranslateRGBH;
}

uint32_t select_pixel_match(const SumoObs *obs, void *)
{
    return (obs->kind == SUMO_OBS_H || obs->kind == SUMO_OBS_H_ROBUST) && is_pixel_match(obs->func.h);
}

const Plx_PyramidLevel *pyramid_level(const Plx_ImagePyramid *p, uint32_t level)
{
    if (p == nullptr || level >= p->no_levels || p->level == nullptr || p->level[level].image == nullptr)
        return nullptr;
    return &p->level[level];
}

// Whether a caller buffer holds none of the pixel images made so far at this level.
bool buffer_free(const LevelModel &lm, const Plx_Image *buffer)
{
    if (buffer == nullptr) return false;
    for (uint32_t i = 0; i < lm.no_regions; ++i)
        if (lm.regions[i].ref_pixels == buffer || lm.regions[i].search_pixels == buffer) return false;
    return true;
}

// One region's states, priors, pixel images and block observations.
bool build_region(LevelModel &lm, RegionWork &w, uint32_t level)
{
    TrackRegion *region = w.region;
    const TrackRegionSettings &set = region->settings;
    const double m = double(1u << level);
    const double zh = region->camera.zh / m;
    const Plx_PyramidLevel *ref = pyramid_level(region->reference_pyramid, level);
    const Plx_PyramidLevel *search = pyramid_level(region->search_pyramid, level);
    const Plx_PyramidLevel *tmpl = pyramid_level(region->template_pyramid, level);
    if (ref == nullptr || search == nullptr) {
        PLX_ERR_START_AS("bMatchImages", PLX_ERROR_ILLEGAL_ARGUMENT, "region pyramid lacks the level", level);
        return false;
    }
    w.ref_level_image = ref->image;
    Sumo *sumo = lm.sumo;
    w.homography_state = pSumoStateVectorNew(sumo, sumo->root, 9, &lm.ms, lm.host);
    if (w.homography_state == nullptr || !bMotionInit(sumo, w.homography_state, set.motion_model, &region->homography))
        return false;
    region->state = w.homography_state;
    if (region->information_given && region->information &&
        !bHomogObs(sumo, w.homography_state, set.motion_model, &region->homography, region->information, &lm.ms,
                   nullptr))
        return false;
    if (set.motion_prior_scale != 0.0 && tmpl && tmpl->image->width > 0 && tmpl->image->height > 0 &&
        !bAddHomogObs(sumo, w.homography_state, set.motion_model, &region->homography, set.motion_prior_scale,
                      uint32_t(tmpl->image->height), uint32_t(tmpl->image->width), zh, &lm.ms))
        return false;
    if (!bIllumInit(sumo, w.homography_state, region->gain, region->offset, &lm.ms, lm.host, &w.illumination_state))
        return false;

    // The caller's buffers take the pixel images when given, unless another region of this
    // level already holds its pixels there (hosts may hand every region the same buffers).
    Plx_Image *ref_buffer = buffer_free(lm, region->template_buffer) ? region->template_buffer : nullptr;
    Plx_Image *search_buffer = region->correlation_buffer != ref_buffer && buffer_free(lm, region->correlation_buffer)
                                   ? region->correlation_buffer
                                   : nullptr;
    w.ref_pixels = pgiSmoothImage(ref->image, ref->mask, set.smoothing_passes, ref_buffer, nullptr, lm.host);
    w.ref_owned = w.ref_pixels != nullptr && w.ref_pixels != ref_buffer;
    if (w.ref_pixels == nullptr) return false;
    w.search_pixels = pgiSmoothImage(search->image, search->mask, set.smoothing_passes, search_buffer, nullptr, lm.host);
    w.search_owned = w.search_pixels != nullptr && w.search_pixels != search_buffer;
    if (w.search_pixels == nullptr) return false;
    // The interpolated central differences make the estimate unbiased under noise; coarser
    // levels keep the interpolant's own derivatives, whose steps agree with the cost, for a
    // wide pull-in while the motion is still far off.
    const bool gradients = level == lm.track->termination_level;
    if (gradients && !bTrackSearchGradients(w.search_pixels, search->mask, &w.gradient_x, &w.gradient_y)) return false;

    TrackPixelObsJob &job = w.job;
    job.sumo = sumo;
    job.ms = &lm.ms;
    job.homography_state = w.homography_state;
    job.illumination_state = w.illumination_state;
    job.model = set.motion_model;
    job.reference = w.ref_pixels;
    job.reference_mask = ref->mask;
    job.search = w.search_pixels;
    job.search_mask = search->mask;
    job.search_gradient_x = gradients ? &w.gradient_x : nullptr;
    job.search_gradient_y = gradients ? &w.gradient_y : nullptr;
    job.zh = zh;
    job.block_size = std::max(set.block_size >> level, 1u);
    job.sampling = set.pixel_sampling >> level;
    job.texture_threshold = set.texture_threshold;
    job.intensity_sigma = set.intensity_sigma;
    job.robust_scale = set.robust_scale;
    job.outlier_cutoff = set.outlier_cutoff;
    if (!bBuildPixelObservations(&job, lm.host)) return false;

    if (set.motion_model == TRACK_MODEL_PROJ) {
        // Keep the region's matrix at the state's scale.
        const double f = plx_mat33_Fnorm_s(&region->homography);
        if (f > 0.0) plx_mat33_scale_s(&region->homography, 1.0 / f, &region->homography);
    }
    return true;
}

bool add_angle_constraints(LevelModel &lm)
{
    if (lm.track->angle_constraints == nullptr) return true;
    for (Plx_ListNode *n = lm.track->angle_constraints->head; n; n = n->next) {
        auto *c = static_cast<TrackAngleConstraint *>(n->data);
        SumoStateVector *s[3];
        for (int k = 0; k < 3; ++k) {
            s[k] = c->points[k] ? c->points[k]->target_state : nullptr;
            if (s[k] == nullptr) {
                PLX_ERR_START_AS("bMatchImages", PLX_ERROR_CALLEE, "angle constraint point without a target state", k);
                return false;
            }
        }
        double angle = c->angle, info = c->information;
        Plx_Vector z;
        plx_vec_form_data(&z, 1, &angle);
        Plx_SquMatrix N;
        plx_squmat_form_data(&N, PLX_SQUMAT_SCALED_IDENTITY, 1, &info);
        SumoObs *o = pSumoObsH_va(lm.sumo, &z, &N, bAngleConstraintH, &lm.ms, s[0], s[1], s[2],
                                  static_cast<SumoStateVector *>(nullptr));
        if (o == nullptr) return false;
        o->z.user_data = &lm.track->angle_pos_threshold_sq;
    }
    return true;
}

// Statistics of one region at the termination level.
bool region_statistics(LevelModel &lm, RegionWork &w)
{
    TrackRegion *region = w.region;
    const Plx_SquMatrix *A = pgsmSumoGetInfmatDiag(w.homography_state);
    const uint32_t n = w.homography_state->x.v.rows;
    if (region->information == nullptr) {
        region->information = plx_squmat_new(PLX_SQUMAT_SYMMETRIC, n);
        if (region->information == nullptr) return false;
    }
    if (A == nullptr || !plx_squmat_resize(region->information, PLX_SQUMAT_SYMMETRIC, n) ||
        !plx_squmat_copy(A, region->information))
        return false;

    const Plx_Image *ref = w.ref_pixels;
    Plx_Image *mask = region->observation_mask;
    mask = mask ? (plx_image_set_gen(mask, PLX_FORMAT_GREY, PLX_TYPE_BIT, ref->height, ref->width) ? mask : nullptr)
                : plx_image_form_gen_b(nullptr, ref->height, ref->width);
    if (mask == nullptr) return false;
    region->observation_mask = mask;
    if (!plx_image_fill_zero(mask)) return false;
    mask->x = w.ref_level_image->x;
    mask->y = w.ref_level_image->y;

    double used = 0.0, rejected = 0.0, chi2 = 0.0;
    for (uint32_t k = 0; k < w.job.no_obs; ++k) {
        SumoObs *o = w.job.obs[k];
        const TrackPixelBlock &b = w.job.blocks[k];
        // The cost also refreshes a robust observation's decision at the final state.
        const double e = dSumoObsComputeResidual(lm.sumo, lm.ws, o);
        if (e == SUMO_FAILED_RESIDUAL) return false;
        if (o->kind == SUMO_OBS_H_ROBUST && o->outlier) {
            rejected += b.no_pixels;
            continue;
        }
        used += b.no_pixels;
        chi2 += e;
        for (uint32_t p = 0; p < b.no_pixels; ++p) {
            const auto c = int32_t(b.positions[2 * p]), r = int32_t(b.positions[2 * p + 1]);
            auto *row = static_cast<uint32_t *>(plx_image_row(mask, r));
            row[c >> 5] |= 1u << (c & 31);
        }
    }
    const TrackRegionSettings &set = region->settings;
    if (used > double(set.min_pixel_count)) {
        region->rms_residual = std::sqrt(chi2 / used);
    } else {
        region->status = TRACK_REGION_TOO_FEW_PIXELS;
        region->rms_residual = DBL_MAX;
    }
    if (used + rejected == 0.0) {
        region->rejected_fraction = DBL_MAX;
    } else {
        region->rejected_fraction = rejected / (used + rejected);
        if (set.max_rejected_fraction != 0.0 && set.max_rejected_fraction < region->rejected_fraction) {
            region->status = TRACK_REGION_LOST;
            region->rejected_fraction = DBL_MAX;
        }
    }
    return true;
}

// An estimated target's position and information. The target's own observations are still
// active, so its diagonal block holds nothing yet: they are folded in first.
bool target_estimate(LevelModel &lm, TrackConstraintPoint *point)
{
    SumoStateVector *s = point->target_state;
    while (s->obs_active != nullptr)
        if (!bSumoObsEliminate(lm.sumo, lm.ws, s->obs_active, lm.host)) return false;
    const Plx_SquMatrix *A = pgsmSumoGetInfmatDiag(s);
    if (A == nullptr) return false;
    point->target_point[0] = s->x.v.data[0];
    point->target_point[1] = s->x.v.data[1];
    point->target_information[0] = plx_squmat_get(A, 0, 0);
    point->target_information[1] = plx_squmat_get(A, 0, 1);
    point->target_information[2] = plx_squmat_get(A, 1, 1);
    return true;
}

bool termination_statistics(LevelModel &lm)
{
    if (!bSumoObsEliminateSelected(lm.sumo, lm.ws, select_pixel_match, nullptr, lm.host)) return false;
    for (uint32_t i = 0; i < lm.no_regions; ++i)
        if (!region_statistics(lm, lm.regions[i])) return false;
    if (lm.track->constraint_points)
        for (Plx_ListNode *n = lm.track->constraint_points->head; n; n = n->next) {
            auto *p = static_cast<TrackConstraintPoint *>(n->data);
            if (!p->target_known && p->target_state && !target_estimate(lm, p)) return false;
        }
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bMatchImages(Track *track, int32_t iterations, double lambda, double lambda_factor, uint32_t level,
                                const ThreadHostInterface *host, StatusTime *status_time)
{
    if (track == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null track", 0);
        return PLX_FALSE;
    }
    if (level > 30) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "level out of range", level);
        return PLX_FALSE;
    }
    const uint32_t no_regions = track->regions ? track->regions->size : 0;
    if (no_regions == 0) return PLX_TRUE;

    LevelModel lm(track, host);
    if (plx_memory_stack_form(&lm.ms, 1000, 1000000) == nullptr) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    lm.ms_formed = true;
    lm.ws = pSumoWorkspaceForm(nullptr);
    lm.sumo = lm.ws ? pSumoForm(nullptr, host) : nullptr;
    if (lm.sumo == nullptr) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    lm.regions = PLX_ALLOC(RegionWork, no_regions);
    if (lm.regions == nullptr) return PLX_FALSE;
    {
        uint32_t i = 0;
        for (Plx_ListNode *n = track->regions->head; n && i < no_regions; n = n->next, ++i) {
            new (&lm.regions[i]) RegionWork();
            lm.regions[i].region = static_cast<TrackRegion *>(n->data);
            lm.regions[i].start = lm.regions[i].region->homography;
            lm.no_regions = i + 1;
        }
    }
    for (uint32_t i = 0; i < lm.no_regions; ++i)
        if (!build_region(lm, lm.regions[i], level)) {
            lm.restore_homographies();
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    bool ok = true;
    if (track->constraint_points)
        for (Plx_ListNode *n = track->constraint_points->head; ok && n; n = n->next)
            ok = bBuildConstraintPointObservations(lm.sumo, track, static_cast<TrackConstraintPoint *>(n->data), level,
                                                   &lm.ms, host) != 0;
    uint32_t first = 0, last = 0;
    ok = ok && add_angle_constraints(lm) && bSumoCreateOffdiagBlocksBranch(lm.sumo, lm.sumo->root, &first, &last);
    if (!ok) {
        lm.restore_homographies();
        PLX_ERR_PASS();
        return PLX_FALSE;
    }

    // Near the minimum the steps fall below what the single-precision residuals can tell
    // apart, and every further step is rejected while the damping only grows. So once the
    // last accepted step changed the cost by less than kSettled of it, kRejections rejected
    // steps in a row end the level instead of running the iterations out.
    constexpr double kSettled = 1e-3;
    constexpr int kRejections = 3;
    bool settled = false;
    int rejected_in_row = 0;
    for (int32_t it = 0; it < iterations; ++it) {
        uint32_t accepted = 0;
        double reduction = 0.0;
        if (!bSumoLevMarqIterationBranchGen(lm.sumo, lm.sumo->root, nullptr, 1, lambda, SUMO_DAMP_ADDITIVE, first,
                                            last, &accepted, &reduction, host)) {
            lm.restore_homographies();
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        bool stop;
        if (accepted) {
            stop = reduction < 0.01;
            settled = reduction < kSettled * (lm.sumo->residual + reduction);  // of the cost before
            rejected_in_row = 0;
            if (!stop) lambda *= lambda_factor;
        } else {
            stop = lm.sumo->residual < 0.01 || (settled && ++rejected_in_row >= kRejections);
            if (!stop) lambda /= lambda_factor;
        }
        if (host && status_time)
            vStatusTimeIncrement(status_time, dTrackEstimateHomogTime(level) * track->status_range, host->progress,
                                 host->callback_context);
        if (interrupted(host)) {
            lm.restore_homographies();
            return PLX_TRUE;
        }
        if (stop) break;
    }

    for (uint32_t i = 0; i < lm.no_regions; ++i) {
        RegionWork &w = lm.regions[i];
        TrackRegion *region = w.region;
        if (!bPixelMatchMatRead(w.homography_state, &region->homography)) {
            lm.restore_homographies();
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        plx_vec_resize(&region->homography_vector, w.homography_state->x.v.rows);
        region->gain = w.illumination_state->x.v.data[0];
        region->offset = w.illumination_state->x.v.data[1];
    }
    if (level == track->termination_level && !termination_statistics(lm)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bTrackHomogOptimise(Track *track, int32_t iterations, double lambda, double lambda_factor,
                                       const ThreadHostInterface *host, StatusTime *status_time)
{
    if (track == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null track", 0);
        return PLX_FALSE;
    }
    if (track->levels == 0) return PLX_TRUE;
    for (uint32_t level = track->levels; level-- > track->termination_level;) {
        if (!bMatchImages(track, iterations, lambda, lambda_factor, level, host, status_time)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        if (interrupted(host)) break;
    }
    return PLX_TRUE;
}

}  // extern "C"
