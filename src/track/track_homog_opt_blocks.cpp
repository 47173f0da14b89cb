// Turning one region's reference pixels into pixel-match observations: the reference pixel
// image is cut into square blocks, each block's used pixels (inside the mask, on the sampling
// pattern, textured enough) become one observation of the homography and illumination states.
#include <algorithm>
#include <cmath>
#include <cstring>

#include "plano/track_homography.h"

namespace {

SumoHFunction pixel_function(uint32_t model, uint32_t channels)
{
    if (channels == 1) {
        switch (model) {
        case TRACK_MODEL_AFFINE: return bPixelMatchAffineH;
        case TRACK_MODEL_PROJ: return bPixelMatchProjH;
        case TRACK_MODEL_TRANSLATE: return bPixelMatchTranslateH;
        case TRACK_MODEL_TRANS_ROT_SCALE: return bPixelMatchTransRotScaleH;
        case TRACK_MODEL_TRANS_SCALE: return bPixelMatchTransScaleH;
        default: return nullptr;
        }
    }
    switch (model) {
    case TRACK_MODEL_AFFINE: return bPixelMatchAffineRGBH;
    case TRACK_MODEL_PROJ: return bPixelMatchProjRGBH;
    case TRACK_MODEL_TRANSLATE: return bPixelMatchTranslateRGBH;
    default: return nullptr;
    }
}

// Channels used of a pixel image: 1 grey, 3 RGB and RGBA; 0 for any other format.
uint32_t used_channels(Plx_ImageFormat format)
{
    if (format == PLX_FORMAT_GREY) return 1;
    if (format == PLX_FORMAT_RGB || format == PLX_FORMAT_RGBA) return 3;
    return 0;
}

// Reads the reference rows for the texture test and the observation values.
struct Reference {
    const Plx_Image *image;
    const Plx_Image *mask;
    uint32_t step;      // floats per pixel
    uint32_t channels;  // used channels

    bool in(int32_t r, int32_t c) const
    {
        if (mask == nullptr) return true;
        const auto *row = static_cast<const uint32_t *>(plx_image_row(mask, r));
        return (row[c >> 5] >> (c & 31)) & 1u;
    }
    const float *at(int32_t r, int32_t c) const
    {
        return static_cast<const float *>(plx_image_row(image, r)) + std::size_t(c) * step;
    }
    // Largest squared difference over the channels along one axis (dx, dy one step), or -1
    // when neither neighbour along it is in the mask.
    float gradient(int32_t r, int32_t c, int32_t dr, int32_t dc) const
    {
        const int32_t limit = dc ? image->width : image->height;
        const int32_t pos = dc ? c : r;
        const bool lo = pos > 0 && in(r - dr, c - dc);
        const bool hi = pos < limit - 1 && in(r + dr, c + dc);
        if (!lo && !hi) return -1.f;
        const float *p = at(r, c);
        const float *a = lo ? at(r - dr, c - dc) : p;
        const float *b = hi ? at(r + dr, c + dc) : p;
        const float k = (lo && hi) ? 0.5f : 1.f;
        float g = 0.f;
        for (uint32_t ch = 0; ch < channels; ++ch) {
            const float d = b[ch] - a[ch];
            g = std::fmax(g, k * d * d);
        }
        return g;
    }
};

// True when every pixel of a bit image is set. A search mask is mostly full (the window lies
// inside the frame); the pixel-match functions then need not test it pixel by pixel.
bool all_set(const Plx_Image *mask)
{
    const int32_t words = mask->width / 32, rest = mask->width % 32;
    for (int32_t r = 0; r < mask->height; ++r) {
        const auto *row = static_cast<const uint32_t *>(plx_image_row(mask, r));
        for (int32_t w = 0; w < words; ++w)
            if (row[w] != ~0u) return false;
        if (rest != 0 && (row[words] & ((1u << rest) - 1u)) != (1u << rest) - 1u) return false;
    }
    return true;
}

bool on_pattern(uint32_t sampling, uint32_t grid, int32_t r, int32_t c)
{
    if (sampling <= 1) return true;
    if (sampling == 2) return ((r + c) & 1) == 0;
    return r % int32_t(grid) == 0 && c % int32_t(grid) == 0;
}

template <class T>
T *stack_array(Plx_MemoryStack *ms, std::size_t n)
{
    return static_cast<T *>(plx_memory_stack_alloc(ms, sizeof(T) * (n ? n : 1)));
}

bool check_job(const TrackPixelObsJob *job, uint32_t *channels)
{
    if (job->sumo == nullptr || job->ms == nullptr || job->homography_state == nullptr ||
        job->reference == nullptr || job->search == nullptr) {
        PLX_ERR_START_AS("gbBuildPixelObservations", PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return false;
    }
    const Plx_Image *ref = job->reference, *s = job->search;
    const uint32_t c = used_channels(ref->format);
    if (c == 0 || used_channels(s->format) != c || ref->type != PLX_TYPE_FLOAT || s->type != PLX_TYPE_FLOAT) {
        PLX_ERR_START_AS("gbBuildPixelObservations", PLX_ERROR_ILLEGAL_ARGUMENT,
                         "pixel images must be float grey, RGB or RGBA alike", ref->format);
        return false;
    }
    if (pixel_function(job->model, c) == nullptr) {
        PLX_ERR_START_AS("gbBuildPixelObservations", PLX_ERROR_ILLEGAL_ARGUMENT,
                         "no pixel-match function for this model and format", job->model);
        return false;
    }
    const Plx_Image *rm = job->reference_mask, *sm = job->search_mask;
    if ((rm && (rm->type != PLX_TYPE_BIT || rm->width != ref->width || rm->height != ref->height)) ||
        (sm && (sm->type != PLX_TYPE_BIT || sm->width != s->width || sm->height != s->height))) {
        PLX_ERR_START_AS("gbBuildPixelObservations", PLX_ERROR_INCOMPATIBLE, "mask does not fit its image", 0);
        return false;
    }
    if (!(job->intensity_sigma * job->intensity_sigma > 0.0)) {
        PLX_ERR_START_AS("gbBuildPixelObservations", PLX_ERROR_DIVISION_BY_ZERO, "intensity sigma is 0", 0);
        return false;
    }
    *channels = c;
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool gbBuildPixelObservations(void *argument)
{
    auto *job = static_cast<TrackPixelObsJob *>(argument);
    if (job == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null job", 0);
        return PLX_FALSE;
    }
    job->blocks_across = job->blocks_down = job->no_obs = 0;
    job->obs = nullptr;
    job->blocks = nullptr;
    uint32_t C;
    if (!check_job(job, &C)) return PLX_FALSE;
    const Plx_Image *ref = job->reference;
    const int32_t w = ref->width, h = ref->height;
    if (w < 2 || h < 2) return PLX_TRUE;

    const uint32_t B = job->block_size ? job->block_size : 1;
    const uint32_t across = (uint32_t(w) + B - 1) / B, down = (uint32_t(h) + B - 1) / B;
    const std::size_t max_blocks = std::size_t(across) * down;
    Plx_MemoryStack *ms = job->ms;
    auto *obs = stack_array<SumoObs *>(ms, max_blocks);
    auto *blocks = stack_array<TrackPixelBlock>(ms, max_blocks);
    auto *positions = stack_array<float>(ms, std::size_t(2) * w * h);
    auto *values = stack_array<double>(ms, std::size_t(B) * B * C);
    if (obs == nullptr || blocks == nullptr || positions == nullptr || values == nullptr) {
        PLX_ERR_PASS_MSG("observation array", 0);
        return PLX_FALSE;
    }
    job->blocks_across = across;
    job->blocks_down = down;
    job->obs = obs;
    job->blocks = blocks;

    const Reference R{ref, job->reference_mask, plx_image_format_channels(ref->format), C};
    const SumoHFunction hf = pixel_function(job->model, C);
    const double t2 = job->texture_threshold * job->texture_threshold;
    const bool texture = job->texture_threshold > 0.0;
    const uint32_t grid = uint32_t(std::floor(std::sqrt(double(job->sampling) + 0.01)));
    double info = 1.0 / (job->intensity_sigma * job->intensity_sigma);
    const bool robust = job->robust_scale != 0.0;
    const double scaling = job->robust_scale * job->robust_scale;
    const Plx_Image *search_mask = job->search_mask != nullptr && !all_set(job->search_mask) ? job->search_mask : nullptr;
    float *next_pos = positions;

    for (uint32_t j = 0; j < down; ++j) {
        for (uint32_t i = 0; i < across; ++i) {
            const int32_t c0 = int32_t(i * B), c1 = std::min(int32_t((i + 1) * B), w);
            const int32_t r0 = int32_t(j * B), r1 = std::min(int32_t((j + 1) * B), h);
            float *block_pos = next_pos;
            uint32_t n = 0;
            for (int32_t r = r0; r < r1; ++r) {
                for (int32_t c = c0; c < c1; ++c) {
                    if (!R.in(r, c) || !on_pattern(job->sampling, grid, r, c)) continue;
                    if (texture) {
                        const float gx = R.gradient(r, c, 0, 1), gy = R.gradient(r, c, 1, 0);
                        if (gx < 0.f || gy < 0.f || double(gx) + double(gy) < t2) continue;
                    }
                    const float *p = R.at(r, c);
                    for (uint32_t ch = 0; ch < C; ++ch) values[n * C + ch] = p[ch];
                    next_pos[0] = float(c) + 0.5f;
                    next_pos[1] = float(r) + 0.5f;
                    next_pos += 2;
                    ++n;
                }
            }
            if (n == 0) continue;
            Plx_Vector z;
            plx_vec_form_data(&z, n * C, values);
            Plx_SquMatrix N;
            plx_squmat_form_data(&N, PLX_SQUMAT_SCALED_IDENTITY, n * C, &info);
            SumoObs *o = robust ? pSumoObsHRobust_va(job->sumo, &z, &N, hf, scaling, n * job->outlier_cutoff, ms,
                                                     job->homography_state, job->illumination_state,
                                                     static_cast<SumoStateVector *>(nullptr))
                                : pSumoObsH_va(job->sumo, &z, &N, hf, ms, job->homography_state,
                                               job->illumination_state, static_cast<SumoStateVector *>(nullptr));
            if (o == nullptr) {
                PLX_ERR_PASS();
                return PLX_FALSE;
            }
            TrackPixelBlock &b = blocks[job->no_obs];
            b.zh = job->zh;
            b.zh_f = float(job->zh);
            b.search_image = job->search;
            b.search_mask = search_mask;
            b.search_gradient_x = job->search_gradient_x;
            b.search_gradient_y = job->search_gradient_y;
            b.positions = block_pos;
            b.no_pixels = n;
            o->z.user_data = &b;
            obs[job->no_obs++] = o;
        }
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bBuildPixelObservations(TrackPixelObsJob *job, const ThreadHostInterface *host)
{
    if (job == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null job", 0);
        return PLX_FALSE;
    }
    if (host == nullptr || host->create_thread == nullptr) {
        if (!gbBuildPixelObservations(job)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        return PLX_TRUE;
    }
    ThreadedWorker *worker = pThreadedWorkerPoolStart(gbBuildPixelObservations, job, host);
    if (worker == nullptr) {
        PLX_ERR_PASS_MSG("Failed to start one or more thread workers", 0);
        return PLX_FALSE;
    }
    if (!gbThreadedWorkerPoolWaitUntilCompleted(worker)) {
        plx_err_register_fileline("bSumoBuildPixelObservations", PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

}  // extern "C"
