// Gaussian smoothing split over host threads: along x in bands of rows, then along y in
// bands of columns. Rows (or columns) of a band are independent in the direction of the
// convolution, so bands need no overlap and jobs write disjoint parts of the output.
#include <algorithm>
#include <cmath>
#include <cstdlib>

#include "common/internal.hpp"
#include "common/job_batch.hpp"
#include "plano/threads.h"

namespace {

// Byte span [lo, hi) covered by an image's rows; empty images cover nothing.
void pixel_span(const Plx_Image *im, uintptr_t *lo, uintptr_t *hi)
{
    *lo = *hi = 0;
    if (im->data == nullptr || im->width <= 0 || im->height <= 0) return;
    const uintptr_t base = reinterpret_cast<uintptr_t>(im->data);
    const intptr_t last = static_cast<intptr_t>(im->height - 1) * im->stride;
    const uintptr_t row = static_cast<uintptr_t>(im->width) * plx_image_format_channels(im->format) *
                          plx_image_type_size(im->type);
    *lo = last < 0 ? base + last : base;
    *hi = (last < 0 ? base : base + last) + row;
}

bool share_pixels(const Plx_Image *a, const Plx_Image *b)
{
    uintptr_t alo, ahi, blo, bhi;
    pixel_span(a, &alo, &ahi);
    pixel_span(b, &blo, &bhi);
    return alo < ahi && blo < bhi && alo < bhi && blo < ahi;
}

// Images and mask made by the call, released on every path.
struct Owned {
    Plx_Mask1D *mask = nullptr;
    Plx_Image *intermediate = nullptr;
    Plx_Image *dest = nullptr;  // released only on failure
    plx::HeapPtr<SmoothingJob> jobs;
    plx::HeapPtr<ThreadedWorker *> workers;

    ~Owned()
    {
        plx_mask1D_free(mask);
        plx_image_free(intermediate);
        plx_image_free(dest);
    }
};

// Runs one pass of n jobs; registers the caller's record on failure.
bool run_pass(const ThreadHostInterface *host, const Plx_Image *source, Plx_Image *target,
              uint32_t direction, const Plx_Mask1D *mask, uint32_t n, Owned &owned)
{
    const uint32_t total = uint32_t(direction == 1 ? source->height : source->width);
    for (uint32_t i = 0; i < n; ++i) {
        const plano::Band band = plano::band_of(i, n, total);
        owned.jobs.get()[i] = SmoothingJob{host, source, target, direction, mask, band.first, band.count};
    }
    const plano::JobsResult result = plano::run_jobs(host, gbApplySmoothingToWindow, owned.jobs.get(),
                                                     sizeof(SmoothingJob), n, owned.workers.get());
    if (result == plano::JobsResult::ok) return true;
    plx_err_register_fileline("pgiThreadedSmoothImage", PLX_ERROR_CALLEE, __FILE__, __LINE__,
                              plano::jobs_failure_message(result), 0);
    return false;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool gbApplySmoothingToWindow(void *job_record)
{
    const auto *job = static_cast<const SmoothingJob *>(job_record);
    if (job == nullptr || job->source == nullptr || job->dest == nullptr || job->mask == nullptr ||
        job->direction > 1) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "incomplete smoothing job", 0);
        return 0;
    }
    const uint32_t chunk = std::max(job->count / 20, 10u);
    // Views of the chunk: zeroed records, so forming a view releases nothing of the caller's.
    Plx_Image source_view{}, dest_view{};
    bool ok = true;
    for (uint32_t done = 0; done < job->count && ok;) {
        const uint32_t n = std::min(chunk, job->count - done);
        const int32_t at = int32_t(job->first + done);
        const Plx_Window window = job->direction == 1 ? Plx_Window{0, at, job->source->width, int32_t(n)}
                                                      : Plx_Window{at, 0, int32_t(n), job->source->height};
        ok = plx_image_extract_q(job->source, window, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &source_view) != nullptr &&
             plx_image_extract_q(job->dest, window, PLX_FORMAT_NONE, PLX_TYPE_NONE, 0, &dest_view) != nullptr;
        if (ok)
            ok = job->direction == 1
                     ? plx_image_convolve1Dx_q(&source_view, -1, PLX_EDGE_EXTEND, job->mask, &dest_view) != 0
                     : plx_image_convolve1Dy_q(&source_view, -1, PLX_EDGE_EXTEND, job->mask, &dest_view) != 0;
        done += n;
        // An interrupt is not a failure: the job ends with what it has done.
        const ThreadHostInterface *host = job->host;
        if (ok && host != nullptr && host->interrupt != nullptr && host->interrupt(host->callback_context) != 0)
            break;
    }
    plx_image_free(&source_view);
    plx_image_free(&dest_view);
    if (!ok) PLX_ERR_PASS();
    return ok ? 1 : 0;
}

PLANO_API Plx_Image *pgiThreadedSmoothImage(const ThreadHostInterface *host, const Plx_Image *source,
                                            Plx_Image *dest, double sigma, Plx_Image *intermediate)
{
    if (source == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null source", 0);
        return nullptr;
    }
    const uint32_t channels = plx_image_format_channels(source->format);
    if (channels == 0 || source->format == PLX_FORMAT_POINTER || source->format > PLX_FORMAT_VECTOR3D) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "format cannot be smoothed", source->format);
        return nullptr;
    }
    if (source->type < PLX_TYPE_UCHAR || source->type > PLX_TYPE_DOUBLE) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "pixel type cannot be smoothed", source->type);
        return nullptr;
    }
    if (intermediate != nullptr && (intermediate == source || intermediate == dest)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the intermediate image must be an image of its own", 0);
        return nullptr;
    }
    if (!(sigma > 0) || !(4.0 * sigma < 1073741823.0)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "sigma out of range", 0);
        return nullptr;
    }
    // Everything that can fail before touching the caller's images comes first.
    Owned owned;
    const uint32_t taps = 2 * uint32_t(std::trunc(4.0 * sigma)) + 1;
    owned.mask = plx_gauss_mask_new(PLX_TYPE_FLOAT, sigma, taps, 1.0);
    if (owned.mask == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    const uint32_t n = plano::job_count(host);
    owned.jobs.reset(PLX_ALLOC(SmoothingJob, n));
    if (!owned.jobs) return nullptr;
    owned.workers.reset(PLX_ALLOC(ThreadedWorker *, n));
    if (!owned.workers) return nullptr;

    const Plx_ImageFormat format = source->format;
    const Plx_PixelType type = source->type;
    const int32_t height = source->height, width = source->width;
    if (dest == nullptr) {
        dest = owned.dest = plx_image_form_gen(nullptr, format, type, height, width);
        if (dest == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
    } else if (!plx_image_set_gen(dest, format, type, height, width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    if (intermediate == nullptr) {
        intermediate = owned.intermediate = plx_image_form_gen(nullptr, format, type, height, width);
        if (intermediate == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
    } else if (!plx_image_set_gen(intermediate, format, type, height, width)) {
        PLX_ERR_PASS();
        return nullptr;
    }
    // dest may be the source itself (the second pass reads only the intermediate), but the
    // intermediate must not overlap either.
    if (share_pixels(intermediate, source) || share_pixels(intermediate, dest)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "the intermediate image shares pixels with source or dest", 0);
        return nullptr;
    }
    if (!run_pass(host, source, intermediate, 1, owned.mask, n, owned) ||
        !run_pass(host, intermediate, dest, 0, owned.mask, n, owned))
        return nullptr;
    owned.dest = nullptr;  // the caller's now
    return dest;
}

}  // extern "C"
