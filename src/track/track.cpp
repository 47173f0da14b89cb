// The tracker object: creation, settings, constraint points and angles, model order, work
// estimates and progress, the homography information matrix, reading back and freeing.
#include <cfloat>
#include <cmath>
#include <cstdlib>
#include <cstring>

#include "common/internal.hpp"
#include "track/track_object_internal.hpp"

namespace plano::track {

uint32_t model_parameter_count(uint32_t model)
{
    switch (model) {
    case TRACK_MODEL_AFFINE: return 6;
    case TRACK_MODEL_PROJ: return 9;
    case TRACK_MODEL_TRANSLATE: return 2;
    case TRACK_MODEL_TRANS_ROT_SCALE: return 4;
    case TRACK_MODEL_TRANS_SCALE: return 3;
    default: return 0;
    }
}

void free_region(TrackRegion *region)
{
    if (region == nullptr) return;
    // Level 0 of every pyramid wraps the region's own windows (released below); clearing the
    // slots keeps caller-supplied pyramid storage free of pointers to released images.
    Plx_ImagePyramid *pyramids[3] = {region->search_pyramid, region->template_pyramid,
                                     region->reference_pyramid};
    for (Plx_ImagePyramid *p : pyramids)
        if (p != nullptr && p->level != nullptr && p->capacity > 0) p->level[0] = Plx_PyramidLevel{nullptr, nullptr};
    for (Plx_ImagePyramid *&p : region->owned_pyramids) {
        if (p == nullptr) continue;
        plx_image_pyramid_free(p);
        std::free(p);
        p = nullptr;
    }
    for (Plx_Image *&image : region->owned_images) {
        plx_image_free(image);
        image = nullptr;
    }
    plx_squmat_free(region->information);
    plx_image_free(region->observation_mask);
    std::free(region);
}

bool track_has_region(const Track *track, const TrackRegion *region)
{
    if (track == nullptr || track->regions == nullptr) return false;
    for (const Plx_ListNode *node = track->regions->head; node != nullptr; node = node->next)
        if (node->data == region) return true;
    return false;
}

}  // namespace plano::track

namespace {

using plano::track::track_has_region;

bool has_constraint_point(const Track *track, const TrackConstraintPoint *point)
{
    for (const Plx_ListNode *node = track->constraint_points->head; node != nullptr; node = node->next)
        if (node->data == point) return true;
    return false;
}

// One constraint point over n regions. Everything is checked before anything changes, so a
// refused point never reaches the track (it would otherwise still act in the optimisation).
TrackConstraintPoint *add_constraint_point(const char *function, Track *track, TrackRegion *const *regions,
                                           uint32_t n, const double *reference_point,
                                           const double *reference_information, const double *target_point,
                                           const double *target_information)
{
    if (track == nullptr || track->constraint_points == nullptr || regions == nullptr || n == 0 ||
        reference_point == nullptr || reference_information == nullptr ||
        (target_point != nullptr && target_information == nullptr)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return nullptr;
    }
    for (uint32_t i = 0; i < n; ++i) {
        if (regions[i] == nullptr) {
            PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null region", i);
            return nullptr;
        }
        if (!track_has_region(track, regions[i])) {
            PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "region does not belong to the track", i);
            return nullptr;
        }
        for (uint32_t j = 0; j < i; ++j)
            if (regions[j] == regions[i]) {
                PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "region listed twice", i);
                return nullptr;
            }
        if (regions[i]->no_constraint_points >= TRACK_MAX_REGION_CONSTRAINT_POINTS) {
            PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "region already has 4 constraint points", i);
            return nullptr;
        }
    }
    auto *point = plx::heap_alloc<TrackConstraintPoint>(1, function, __FILE__, __LINE__);
    if (point == nullptr) return nullptr;
    std::memset(static_cast<void *>(point), 0, sizeof *point);
    point->regions = plx::heap_alloc<TrackRegion *>(n, function, __FILE__, __LINE__);
    if (point->regions == nullptr) {
        std::free(point);
        return nullptr;
    }
    std::memcpy(static_cast<void *>(point->regions), regions, sizeof(TrackRegion *) * n);
    point->no_regions = n;
    std::memcpy(point->reference_point, reference_point, sizeof point->reference_point);
    std::memcpy(point->reference_information, reference_information, sizeof point->reference_information);
    point->target_known = target_point != nullptr ? 1u : 0u;
    if (target_point != nullptr) {
        std::memcpy(point->target_point, target_point, sizeof point->target_point);
        std::memcpy(point->target_information, target_information, sizeof point->target_information);
    }
    if (!plx_list_insert_first(track->constraint_points, point)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        std::free(point->regions);
        std::free(point);
        return nullptr;
    }
    for (uint32_t i = 0; i < n; ++i) regions[i]->constraint_points[regions[i]->no_constraint_points++] = point;
    return point;
}

}  // namespace

extern "C" {

PLANO_API Track *pTrackNew(Plx_Image *previous_image, const Plx_Camera *previous_camera, Plx_Image *current_image,
                           const Plx_Camera *current_camera, uint32_t levels, Plx_Image *distance_scratch)
{
    if (previous_image == nullptr || current_image == nullptr || previous_camera == nullptr ||
        current_camera == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing image or camera", 0);
        return nullptr;
    }
    if (levels == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "a track needs at least one pyramid level", 0);
        return nullptr;
    }
    if (previous_camera->zh != current_camera->zh) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "the cameras' homogeneous coordinates differ", 0);
        return nullptr;
    }
    auto *track = PLX_ALLOC(Track, 1);
    if (track == nullptr) return nullptr;
    std::memset(static_cast<void *>(track), 0, sizeof *track);
    track->previous_image = previous_image;
    track->current_image = current_image;
    track->previous_camera = *previous_camera;
    track->current_camera = *current_camera;
    track->levels = levels;
    track->termination_level = 0;
    track->extract_active_channel = 1;
    track->angle_pos_threshold_sq = 0.0;
    track->status_start = 0.0;
    track->status_range = 1.0;
    track->display_zoom = 1.0;
    track->distance_scratch = distance_scratch;
    track->regions = plx_list_new();
    track->constraint_points = plx_list_new();
    track->angle_constraints = plx_list_new();
    if (track->regions == nullptr || track->constraint_points == nullptr || track->angle_constraints == nullptr) {
        PLX_ERR_PASS();
        plx_list_free(track->regions, nullptr);
        plx_list_free(track->constraint_points, nullptr);
        plx_list_free(track->angle_constraints, nullptr);
        std::free(track);
        return nullptr;
    }
    return track;
}

PLANO_API void vTrackSetExtractActiveChannel(Track *track, uint32_t flag)
{
    if (track != nullptr) track->extract_active_channel = flag;
}

PLANO_API void vTrackSetTerminationLevel(Track *track, uint32_t level)
{
    if (track == nullptr) return;
    track->termination_level = level < track->levels ? level : track->levels - 1;
}

PLANO_API void vTrackSetAngleConstraintPosThreshold(Track *track, double threshold)
{
    if (track != nullptr) track->angle_pos_threshold_sq = threshold * threshold;
}

PLANO_API void vTrackSetStatusTimeLimits(Track *track, double start, double end)
{
    if (track == nullptr) return;
    track->status_start = start;
    track->status_range = end - start;
}

PLANO_API void vTrackSetDisplayZoom(Track *track, double zoom)
{
    if (track != nullptr) track->display_zoom = zoom;
}

PLANO_API void vTrackRegionSetBoundaryDistanceWeighting(TrackRegion *region, uint32_t flag)
{
    if (region != nullptr) region->boundary_distance_weighting = flag;
}

PLANO_API TrackConstraintPoint *pTrackConstraintPoint1Region(Track *track, TrackRegion *region,
                                                             const double reference_point[2],
                                                             const double reference_information[3],
                                                             const double target_point[2],
                                                             const double target_information[3])
{
    if (target_point == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "a one-region constraint point needs its target", 0);
        return nullptr;
    }
    TrackRegion *regions[1] = {region};
    return add_constraint_point(__func__, track, regions, 1, reference_point, reference_information, target_point,
                                target_information);
}

PLANO_API TrackConstraintPoint *pTrackConstraintPoint2Regions(Track *track, TrackRegion *region_a,
                                                              TrackRegion *region_b, const double reference_point[2],
                                                              const double reference_information[3],
                                                              const double *target_point,
                                                              const double target_information[3])
{
    TrackRegion *regions[2] = {region_a, region_b};
    return add_constraint_point(__func__, track, regions, 2, reference_point, reference_information, target_point,
                                target_information);
}

PLANO_API TrackConstraintPoint *pTrackConstraintPointNRegions(Track *track, TrackRegion **regions,
                                                              uint32_t no_regions, const double reference_point[2],
                                                              const double reference_information[3],
                                                              const double *target_point,
                                                              const double target_information[3])
{
    return add_constraint_point(__func__, track, regions, no_regions, reference_point, reference_information,
                                target_point, target_information);
}

PLANO_API Plx_Bool bAngleConstraint(Track *track, TrackConstraintPoint *a, TrackConstraintPoint *b,
                                    TrackConstraintPoint *c, double angle, double sigma)
{
    if (track == nullptr || track->angle_constraints == nullptr || a == nullptr || b == nullptr || c == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return 0;
    }
    if (!has_constraint_point(track, a) || !has_constraint_point(track, b) || !has_constraint_point(track, c)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "constraint point does not belong to the track", 0);
        return 0;
    }
    if (sigma == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "angle sigma is 0", 0);
        return 0;
    }
    auto *constraint = PLX_ALLOC(TrackAngleConstraint, 1);
    if (constraint == nullptr) return 0;
    constraint->points[0] = a;
    constraint->points[1] = b;
    constraint->points[2] = c;
    constraint->angle = angle;
    constraint->information = 1.0 / (sigma * sigma);
    if (!plx_list_insert_first(track->angle_constraints, constraint)) {
        PLX_ERR_PASS();
        std::free(constraint);
        return 0;
    }
    return 1;
}

PLANO_API uint32_t eMostGeneralTrackingModel(uint32_t model_a, uint32_t model_b)
{
    if (plano::track::model_parameter_count(model_a) == 0 || plano::track::model_parameter_count(model_b) == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown motion model",
                      plano::track::model_parameter_count(model_a) == 0 ? model_a : model_b);
        return 0xFFFFFFFFu;
    }
    // Each step of the order holds every model after it as a special case.
    static constexpr uint32_t order[] = {TRACK_MODEL_PROJ, TRACK_MODEL_AFFINE, TRACK_MODEL_TRANS_ROT_SCALE,
                                         TRACK_MODEL_TRANS_SCALE};
    for (uint32_t model : order)
        if (model_a == model || model_b == model) return model;
    return TRACK_MODEL_TRANSLATE;
}

PLANO_API double dTrackEstimateCorrTime(const Track *track)
{
    if (track == nullptr || track->regions == nullptr) return 0.0;
    double largest = 0.0;
    for (const Plx_ListNode *node = track->regions->head; node != nullptr; node = node->next) {
        const auto *region = static_cast<const TrackRegion *>(node->data);
        if (region->settings.correlation_size == TRACK_NO_CORRELATION) continue;
        const double m = double(region->settings.search_range_x) * double(region->settings.search_range_y);
        if (m > largest) largest = m;
    }
    return double(track->regions->size) * std::sqrt(largest) * 0.3;
}

PLANO_API double dTrackEstimateHomogTime(uint32_t level)
{
    return 0.6 / std::pow(3.0, double(level));
}

PLANO_API void vStatusTimeIncrement(StatusTime *status_time, double increment, ThreadProgressFunction progress,
                                    void *context)
{
    if (status_time == nullptr) return;
    status_time->done += increment;
    if (progress == nullptr) return;
    // A zero or broken total reports the start rather than dividing by it.
    const double fraction = status_time->total > 0.0 ? status_time->done * 100.0 / status_time->total : 0.0;
    int32_t percentage = 0;
    if (fraction >= 99.0)
        percentage = 99;
    else if (fraction > 0.0)
        percentage = int32_t(fraction);
    progress(context, percentage);
}

PLANO_API Plx_SquMatrix *pgsymmatComputeInformationMatrix(const Plx_Matrix33 *homography)
{
    if (homography == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null homography", 0);
        return nullptr;
    }
    const double *h = &homography->m[0][0];
    double norm2 = 0.0;
    for (int i = 0; i < 9; ++i) norm2 += h[i] * h[i];
    if (!std::isfinite(norm2)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "homography is not finite", 0);
        return nullptr;
    }
    if (norm2 == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "homography is zero", 0);
        return nullptr;
    }
    double m[9][9];
    for (int i = 0; i < 9; ++i)
        for (int j = 0; j < 9; ++j) m[i][j] = (i == j ? 1.0 : 0.0) - h[i] * h[j] / norm2;
    // Each pivot term is (1/|hk|) sum_i (|hk| x_i - sign(hk) h_i x_k)^2 as a quadratic form:
    // positive semi-definite with h in its null space. Taking |hk| keeps the sum positive
    // semi-definite when a pivot is negative (H and -H are the same homography).
    for (int k : {0, 4, 8}) {
        if (h[k] == 0.0) continue;
        const double a = std::fabs(h[k]);
        const double s = h[k] > 0 ? 1.0 : -1.0;
        double rest = 0.0;
        for (int i = 0; i < 9; ++i) {
            if (i == k) continue;
            rest += h[i] * h[i];
            m[i][i] += a;
            m[i][k] -= s * h[i];
            m[k][i] -= s * h[i];
        }
        m[k][k] += rest / a;
    }
    Plx_SquMatrix *info = plx_squmat_new(PLX_SQUMAT_SYMMETRIC, 9);
    if (info == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    for (auto &row : m)
        for (double &v : row) v *= 100.0;
    if (!plx_squmat_fill(info, &m[0][0])) {
        PLX_ERR_PASS();
        plx_squmat_free(info);
        return nullptr;
    }
    return info;
}

PLANO_API Plx_Bool bTrackMotionRead(const TrackRegion *region, Plx_Matrix33 *homography)
{
    if (region == nullptr || homography == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return 0;
    }
    *homography = region->homography;
    return 1;
}

PLANO_API Plx_SquMatrix *psmTrackInfmatRead(const TrackRegion *region)
{
    if (region == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null region", 0);
        return nullptr;
    }
    return region->information;
}

PLANO_API Plx_Bool bTrackIntensityModelRead(const TrackRegion *region, double intensity[2])
{
    if (region == nullptr || intensity == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return 0;
    }
    intensity[0] = region->gain;
    intensity[1] = region->offset;
    return 1;
}

PLANO_API void vTrackFree(Track *track)
{
    if (track == nullptr) return;
    plx_list_free(track->angle_constraints, std::free);
    if (track->constraint_points != nullptr) {
        for (Plx_ListNode *node = track->constraint_points->head; node != nullptr; node = node->next) {
            auto *point = static_cast<TrackConstraintPoint *>(node->data);
            std::free(point->regions);
            std::free(point);
        }
        plx_list_free(track->constraint_points, nullptr);
    }
    if (track->regions != nullptr) {
        for (Plx_ListNode *node = track->regions->head; node != nullptr; node = node->next)
            plano::track::free_region(static_cast<TrackRegion *>(node->data));
        plx_list_free(track->regions, nullptr);
    }
    std::free(track);
}

}  // extern "C"
