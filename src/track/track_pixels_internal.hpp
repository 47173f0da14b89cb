// Small helpers shared by the tracker's pixel preparation and correlation: bit-row access,
// image checks, and one threaded run of row stripes.
#ifndef PLANO_SRC_TRACK_TRACK_PIXELS_INTERNAL_HPP
#define PLANO_SRC_TRACK_TRACK_PIXELS_INTERNAL_HPP

#include <cstdint>

#include "common/internal.hpp"
#include "common/job_batch.hpp"
#include "pellux/image.h"
#include "plano/threads.h"

namespace plano::track {

inline const uint32_t *bit_row(const Plx_Image *im, int32_t r)
{
    return static_cast<const uint32_t *>(plx_image_row(im, r));
}
inline uint32_t *bit_row(Plx_Image *im, int32_t r) { return static_cast<uint32_t *>(plx_image_row(im, r)); }
inline bool test_bit(const uint32_t *row, int32_t c) { return (row[c >> 5] >> (c & 31)) & 1u; }
inline void set_bit(uint32_t *row, int32_t c) { row[c >> 5] |= 1u << (c & 31); }
inline void clear_bit(uint32_t *row, int32_t c) { row[c >> 5] &= ~(1u << (c & 31)); }
inline int32_t words_of(int32_t width) { return (width + 31) >> 5; }

// True for a grey bit image of exactly height x width.
inline bool is_mask_of(const Plx_Image *mask, int32_t height, int32_t width)
{
    return mask->type == PLX_TYPE_BIT && mask->format == PLX_FORMAT_GREY && mask->height == height &&
           mask->width == width;
}

// (Re)forms a caller buffer, or a new image when there is none; null with the trace set.
inline Plx_Image *form_or_reuse(Plx_Image *buffer, Plx_ImageFormat format, Plx_PixelType type,
                                int32_t height, int32_t width)
{
    if (buffer == nullptr) return plx_image_form_gen(nullptr, format, type, height, width);
    return plx_image_set_gen(buffer, format, type, height, width) ? buffer : nullptr;
}

// Frees an image only when it is not the caller's buffer.
struct OwnedImage {
    Plx_Image *image = nullptr;
    bool owned = false;
    OwnedImage() = default;
    OwnedImage(const OwnedImage &) = delete;
    OwnedImage &operator=(const OwnedImage &) = delete;
    ~OwnedImage()
    {
        if (owned) plx_image_free(image);
    }
    // Forms into buffer when given, else a new image owned here.
    bool form(Plx_Image *buffer, Plx_ImageFormat format, Plx_PixelType type, int32_t height, int32_t width)
    {
        image = form_or_reuse(buffer, format, type, height, width);
        owned = image != nullptr && buffer == nullptr;
        return image != nullptr;
    }
    Plx_Image *release()
    {
        owned = false;
        return image;
    }
};

// Runs n job records of type Job through the host's pool (job 0 on the calling thread). On
// failure registers a code-1 record under `function` with the pool's message.
template <class Job>
bool run_stripes(const char *function, const ThreadHostInterface *host, ThreadedJobFunction fn, Job *jobs,
                 uint32_t n)
{
    plx::HeapPtr<ThreadedWorker *> workers(PLX_ALLOC(ThreadedWorker *, n));
    if (!workers) return false;
    const JobsResult result = run_jobs(host, fn, jobs, sizeof(Job), n, workers.get());
    if (result == JobsResult::ok) return true;
    plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, jobs_failure_message(result), 0);
    return false;
}

}  // namespace plano::track

#endif
