// The per-frame driver: the coarse search of every region, the joint homography optimisation,
// progress and interrupts through the host, and the results handed back in the calibrated
// coordinates of the cameras.
#include <cmath>

#include "common/internal.hpp"
#include "plano/track_correlation.h"
#include "plano/track_homography.h"
#include "track/track_object_internal.hpp"

namespace {

bool interrupted(const ThreadHostInterface *host)
{
    return host != nullptr && host->interrupt != nullptr && host->interrupt(host->callback_context) != 0;
}

// Every return hands the regions back in calibrated coordinates, including an interrupt and a
// track whose coarse search found nothing: a caller reading a region must never see window
// pixels. back() reports whether that worked; the destructor covers the failure paths.
struct CalibratedOnReturn {
    Track *track;
    bool done = false;

    bool all_back()
    {
        bool ok = true;
        for (Plx_ListNode *node = track->regions->head; node != nullptr; node = node->next) {
            auto *region = static_cast<TrackRegion *>(node->data);
            if (region->in_window_pixels && !plano::track::region_to_calibrated(track, region, "bTrackOptimise"))
                ok = false;
        }
        return ok;
    }
    bool back()
    {
        done = true;
        return all_back();
    }
    ~CalibratedOnReturn()
    {
        if (done) return;
        // Already failing: the trace must keep describing the first failure.
        Plx_ErrorRecord saved[PLX_ERROR_TRACE_CAPACITY];
        uint32_t count = 0;
        while (count < PLX_ERROR_TRACE_CAPACITY && plx_err_get_error(count, &saved[count])) ++count;
        if (all_back()) return;
        plx_err_flush_trace();
        for (uint32_t i = 0; i < count; ++i)
            plx_err_register_fileline(saved[i].function, saved[i].code, saved[i].file, saved[i].line,
                                      saved[i].message, saved[i].number);
    }
};

}  // namespace

extern "C" {

PLANO_API Plx_Bool bTrackOptimise(Track *track, int32_t iterations, double lambda, double lambda_factor,
                                  const ThreadHostInterface *host)
{
    if (track == nullptr || track->regions == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null track", 0);
        return 0;
    }
    const uint32_t n = plx_list_get_size(track->regions);
    if (n == 0) return 1;
    // A second call starts again from window pixels.
    for (Plx_ListNode *node = track->regions->head; node != nullptr; node = node->next) {
        auto *region = static_cast<TrackRegion *>(node->data);
        if (!region->in_window_pixels && !plano::track::region_to_window_pixels(track, region, __func__)) {
            PLX_ERR_PASS();
            return 0;
        }
    }
    CalibratedOnReturn calibrated{track};
    auto finish = [&]() -> Plx_Bool {
        if (calibrated.back()) return 1;
        PLX_ERR_PASS();
        return 0;
    };

    const ThreadProgressFunction progress = host != nullptr ? host->progress : nullptr;
    void *const context = host != nullptr ? host->callback_context : nullptr;
    const double corr = dTrackEstimateCorrTime(track);
    const double share = corr / n * track->status_range;
    double homog = 0.0;
    for (uint32_t level = track->levels; level-- > track->termination_level;)
        homog += dTrackEstimateHomogTime(level) * double(iterations > 0 ? iterations : 0);
    StatusTime status_time{corr + homog, 0.0};
    status_time.done = track->status_start * status_time.total;

    const uint32_t few_regions = n < 6 ? 1u : 0u;
    for (Plx_ListNode *node = track->regions->head; node != nullptr; node = node->next) {
        auto *region = static_cast<TrackRegion *>(node->data);
        if (!bTrackRegionOptimise(track, region, &status_time, share, few_regions, host)) {
            PLX_ERR_PASS();
            for (Plx_ListNode *r = track->regions->head; r != nullptr; r = r->next)
                static_cast<TrackRegion *>(r->data)->status = TRACK_REGION_LOST;
            return 0;
        }
        if (interrupted(host)) return finish();
        if (!few_regions) vStatusTimeIncrement(&status_time, share, progress, context);
    }
    if (interrupted(host)) return finish();

    bool any_ok = false;
    for (Plx_ListNode *node = track->regions->head; node != nullptr; node = node->next)
        any_ok = any_ok || static_cast<TrackRegion *>(node->data)->status == TRACK_REGION_OK;
    if (!any_ok) return finish();
    if (!bTrackHomogOptimise(track, iterations, lambda, lambda_factor, host, &status_time)) {
        PLX_ERR_PASS();
        return 0;
    }
    return finish();
}

}  // extern "C"
