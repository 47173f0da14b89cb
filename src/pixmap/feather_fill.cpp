// The feathered (alpha) filler: the hard fill as 1 and 0, then every edge ramped over its
// widths on both sides. Each pixel keeps the largest value offered outside the outline and
// the smallest inside it, so the edges may be ramped in any order, and bands of rows can be
// done by separate jobs with the same result.
#include <algorithm>
#include <cmath>
#include <vector>

#include "common/internal.hpp"
#include "common/job_batch.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "pixmap/pixmap_spans.hpp"
#include "plano/polygon_fill.h"

namespace plano::pixmap {

namespace {

struct FeatherBand {
    BandQuad quad;
    float mid_t;
};

struct FeatherPlan {
    Plx_Image *alpha;
    const Plx_Image *inside;
    Plx_Image *t_image;
    Polygon2DTFunc t_func;
    Polygon2DAlphaFunc alpha_func;
    uint32_t sense;
    const FeatherBand *bands;
    std::size_t band_count;
};

struct FeatherJob {
    const FeatherPlan *plan;
    int32_t first_row, end_row;
};

// T wraps at 1 on closed curves: the edge from T 0.9 to T 0.1 has its middle at 0.
float mid_t(const Polygon2DEdge &e)
{
    if (e.end_t > e.start_t) return (e.start_t + e.end_t) / 2.0f;
    float t = (e.start_t + e.end_t + 1.0f) / 2.0f;
    if (t >= 1.0f) t -= 1.0f;
    return t;
}

// The feather value of a pixel at band position lambda, or a negative number when the band
// offers none. Outside the outline the ramp falls from the outline's value to 0 at the offset
// line; inside it rises to 1.
inline float feather_value(uint32_t sense, bool inside, double lambda)
{
    double v;
    if (inside) {
        if (sense == 0) return 1.0f;
        if (sense == 1 && lambda < 0.0) return -1.0f;
        v = sense == 2 ? lambda : 0.5 + 0.5 * lambda;
    } else {
        if (sense == 2) return 0.0f;
        if (sense == 1 && lambda < 0.0) return -1.0f;
        v = sense == 0 ? 1.0 - lambda : 0.5 - 0.5 * lambda;
    }
    return v >= 0.0 && v <= 1.0 ? float(v) : -1.0f;
}

void ramp_band(const FeatherPlan &plan, const FeatherBand &band, int32_t first_row, int32_t end_row)
{
    for_band_pixels(plan.alpha, band.quad, first_row, end_row, [&plan, &band](int32_t r, int32_t c, double lambda) {
        const bool inside = bit_at(static_cast<const uint32_t *>(plx_image_row(plan.inside, r)), c);
        const float v = feather_value(plan.sense, inside, lambda);
        if (v < 0.0f) return;
        float &out = static_cast<float *>(plx_image_row(plan.alpha, r))[c];
        const float mapped = plan.alpha_func != nullptr ? plan.alpha_func(v) : v;
        if (inside ? !(mapped < out) : !(mapped > out)) return;
        out = mapped;
        if (plan.t_image != nullptr) static_cast<float *>(plx_image_row(plan.t_image, r))[c] = plan.t_func(v, band.mid_t);
    });
}

// Job: the rows [first_row, end_row) of the float image from the mask, then every band.
Plx_Bool feather_rows(void *record)
{
    const FeatherJob &job = *static_cast<const FeatherJob *>(record);
    const FeatherPlan &plan = *job.plan;
    const int32_t width = plan.alpha->width;
    for (int32_t r = job.first_row; r < job.end_row; ++r) {
        const uint32_t *in = static_cast<const uint32_t *>(plx_image_row(plan.inside, r));
        float *out = static_cast<float *>(plx_image_row(plan.alpha, r));
        for (int32_t c = 0; c < width; c += 32) {
            const uint32_t word = in[c >> 5];
            const int32_t n = std::min(32, width - c);
            if (word == 0u || word == ~0u) {
                std::fill(out + c, out + c + n, word == 0u ? 0.0f : 1.0f);
                continue;
            }
            for (int32_t k = 0; k < n; ++k) out[c + k] = float((word >> k) & 1u);
        }
    }
    for (std::size_t i = 0; i < plan.band_count; ++i) ramp_band(plan, plan.bands[i], job.first_row, job.end_row);
    return 1;
}

bool same_size(const Plx_Image *a, const Plx_Image *b) { return a->width == b->width && a->height == b->height; }

bool check_feather_images(const Plx_Image *alpha, const Plx_Image *inside, const Plx_Image *t_image,
                          Polygon2DTFunc t_func, const char *function)
{
    if (!check_image(alpha, function)) return false;
    if (alpha->format != PLX_FORMAT_GREY || alpha->type != PLX_TYPE_FLOAT) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "feathered fill needs a float grey image", 0);
        return false;
    }
    if (inside != nullptr && !check_bit_image(inside, function)) return false;
    if (t_image != nullptr && t_func != nullptr) {
        if (!check_image(t_image, function)) return false;
        if (t_image->format != PLX_FORMAT_GREY || t_image->type != PLX_TYPE_FLOAT) {
            PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "the T image must be float grey", 0);
            return false;
        }
    }
    if ((inside != nullptr && !same_size(inside, alpha)) ||
        (t_image != nullptr && t_func != nullptr && !same_size(t_image, alpha))) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "images of different sizes", 0);
        return false;
    }
    return true;
}

}  // namespace

bool feather_fill(Plx_Image *alpha, const Plx_Image *inside, const Polygon2D *polygon, Plx_Image *t_image,
                  Polygon2DTFunc t_func, const ThreadHostInterface *host, const char *function)
{
    if (!check_polygon(polygon, function) || !check_feather_images(alpha, inside, t_image, t_func, function))
        return false;
    if (polygon->edge_sense > 2) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "edge sense", int64_t(polygon->edge_sense));
        return false;
    }
    if (alpha->width == 0 || alpha->height == 0) return true;
    auto fail = [function] {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    };
    Plx_Image own_mask{};
    struct MaskGuard {
        Plx_Image *image;
        ~MaskGuard() { plx_image_free(image); }
    } guard{nullptr};
    if (inside == nullptr) {
        if (plx_image_form_gen_b(&own_mask, alpha->height, alpha->width) == nullptr) return fail();
        guard.image = &own_mask;
        if (!plx_image_fill_zero(&own_mask)) return fail();
        own_mask.x = alpha->x, own_mask.y = alpha->y;
        if (!fill_bits(&own_mask, polygon, 1, 0, function)) return false;
        inside = &own_mask;
    }
    std::vector<FeatherBand> bands;
    try {
        for (const Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next) {
            const Polygon2DEdge *previous = e->previous != nullptr ? e->previous : polygon->tail;
            const Polygon2DEdge *next = e->next != nullptr ? e->next : polygon->head;
            double p[4][2];
            offset_points(*e, previous, next, p);
            const float t = mid_t(*e);
            for (int side = 0; side < 4; side += 2) {
                const BandQuad q{e->x, e->y, e->end_x, e->end_y, p[side][0], p[side][1], p[side + 1][0], p[side + 1][1]};
                if (!band_degenerate(q)) bands.push_back(FeatherBand{q, t});
            }
        }
    } catch (...) {
        PLX_ERR_START_AS(function, PLX_ERROR_MALLOC_FAILED, "bands", int64_t((bands.size() + 2) * sizeof(FeatherBand)));
        return false;
    }
    const FeatherPlan plan{alpha, inside, t_func != nullptr ? t_image : nullptr, t_func, polygon->alpha_func,
                           polygon->edge_sense, bands.data(), bands.size()};
    // Bands of fewer rows do not repay starting a job.
    constexpr uint32_t kMinRowsPerJob = 32;
    const uint32_t n = std::max(1u, std::min(job_count(host), uint32_t(alpha->height) / kMinRowsPerJob));
    if (n == 1) {
        FeatherJob job{&plan, 0, alpha->height};
        return feather_rows(&job) != 0;
    }
    plx::HeapPtr<FeatherJob> jobs(PLX_ALLOC(FeatherJob, n));
    plx::HeapPtr<ThreadedWorker *> workers(PLX_ALLOC(ThreadedWorker *, n));
    if (!jobs || !workers) return fail();
    for (uint32_t i = 0; i < n; ++i) {
        const Band band = band_of(i, n, uint32_t(alpha->height));
        jobs.get()[i] = FeatherJob{&plan, int32_t(band.first), int32_t(band.first + band.count)};
    }
    const JobsResult result = run_jobs(host, feather_rows, jobs.get(), sizeof(FeatherJob), n, workers.get());
    if (result != JobsResult::ok) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, jobs_failure_message(result), 0);
        return false;
    }
    return true;
}

}  // namespace plano::pixmap

extern "C" {

PLANO_API Plx_Bool bImageFillPolygonAlpha(Plx_Image *alpha, const Plx_Image *inside, const Polygon2D *polygon,
                                          Plx_Image *t_image, Polygon2DTFunc t_func)
{
    return plano::pixmap::feather_fill(alpha, inside, polygon, t_image, t_func, nullptr, __func__) ? 1 : 0;
}

PLANO_API Plx_Bool bImageFillPolygonAlphaThreaded(Plx_Image *alpha, const Plx_Image *inside,
                                                  const Polygon2D *polygon, Plx_Image *t_image,
                                                  Polygon2DTFunc t_func, const ThreadHostInterface *host)
{
    return plano::pixmap::feather_fill(alpha, inside, polygon, t_image, t_func, host, __func__) ? 1 : 0;
}

}  // extern "C"
