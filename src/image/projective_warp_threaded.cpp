// The projective warp split over host threads by output rows. Everything shared is done
// once on the calling thread (checks, the background copy, the validity mask's set-up);
// each job then warps its own band of rows as an output window and writes only those rows
// of the output and of the validity mask.
#include "common/internal.hpp"
#include "common/job_batch.hpp"
#include "image/projective_warp_internal.hpp"

namespace {

constexpr const char *kName = "bImageProjectiveWarpThreaded";

struct BandJob {
    plano::warp::WarpCall call;
    ProjectiveWarpParams params;
    uint32_t statistics;
};

Plx_Bool warp_band(void *record)
{
    auto *job = static_cast<BandJob *>(record);
    job->call.params = &job->params;
    job->call.statistics = &job->statistics;
    return plano::warp::warp(job->call, "bImageProjectiveWarp") ? 1 : 0;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bImageProjectiveWarpThreaded(
    const Plx_Image *background, const Plx_Image *output_mask, const Plx_Camera *camera_a, const Plx_Image *source,
    const Plx_Image *source_mask, const Plx_Camera *camera_b, const Plx_Matrix33 *homography,
    const ProjectiveWarpParams *params, Plx_Image *output, Plx_Image *validity, const ThreadHostInterface *host,
    uint32_t *statistics, Plx_Bool copy_background)
{
    using namespace plano::warp;
    WarpCall call{background, output_mask, camera_a, source,     source_mask,         camera_b, homography, params,
                  output,     validity,    host,     statistics, copy_background != 0, true,    true};
    if (host == nullptr) return warp(call, kName) ? 1 : 0;
    if (background == nullptr || source == nullptr || output == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null background, source or output", 0);
        return 0;
    }
    if (background->width <= 0 || background->height <= 0 || source->width <= 0 || source->height <= 0) return 1;
    ProjectiveWarpParams p;
    if (params != nullptr)
        p = *params;
    else
        vInitProjectiveWarpParams(&p);
    // Refuse what the jobs would refuse before anything is written.
    Mapping map;
    if (!check_call(call, kName) || !build_mapping(camera_a, homography, camera_b, map, kName)) return 0;
    const uint32_t n = plano::job_count(host);
    plx::HeapPtr<BandJob> jobs(PLX_ALLOC(BandJob, n));
    if (!jobs) return 0;
    plx::HeapPtr<ThreadedWorker *> workers(PLX_ALLOC(ThreadedWorker *, n));
    if (!workers) return 0;
    if (call.copy_background && !plano::warp::copy_background(background, output, kName)) return 0;
    if (!init_validity(output_mask, p.ignore_output_mask != 0, output, validity, kName)) return 0;

    int32_t x0 = output->x, y0 = output->y, width = output->width, height = output->height;
    if (p.window_width > 0) x0 = p.window_x, y0 = p.window_y, width = p.window_width, height = p.window_height;
    if (width <= 0 || height <= 0) return 1;
    for (uint32_t i = 0; i < n; ++i) {
        const plano::Band band = plano::band_of(i, n, uint32_t(height));
        BandJob &job = jobs.get()[i];
        job.call = call;
        job.call.copy_background = false;
        job.call.init_validity = false;
        // One job reporting progress keeps the reports in order.
        job.call.report_progress = i == 0;
        job.params = p;
        job.params.window_x = x0;
        job.params.window_y = y0 + int32_t(band.first);
        job.params.window_width = width;
        job.params.window_height = int32_t(band.count);
        job.statistics = 0;
    }
    const plano::JobsResult result = plano::run_jobs(host, warp_band, jobs.get(), sizeof(BandJob), n, workers.get());
    if (result != plano::JobsResult::ok) {
        PLX_ERR_PASS_MSG(plano::jobs_failure_message(result), 0);
        return 0;
    }
    if (statistics != nullptr)
        for (uint32_t i = 0; i < n; ++i) *statistics += jobs.get()[i].statistics;
    return 1;
}

}  // extern "C"
