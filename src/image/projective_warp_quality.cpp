// The warp's high-quality per-pixel fill: neighbours outside the source (or its mask) count
// as zero pixels so edges fade out over one pixel, optional motion blur over an ellipse
// given per output pixel, and alpha weighting of the colour channels.
#include <algorithm>
#include <cmath>
#include <cstdio>

#include "image/projective_warp_internal.hpp"

namespace plano::warp {

namespace {

constexpr int kMaxBlurSamples = 20000;
// A degenerate ellipse (a line of motion) is widened by half a pixel so that grid points
// along it are kept.
constexpr float kLineWidening = 0.25f;
constexpr float kMinAlpha = 0.0001f;
constexpr float kMaxAlphaFactor = 10000.0f;

// Sum of the bilinear sample at (x, y) (source-local, minus 0.5) with zero-valued
// neighbours outside the source or its mask, and of the weights of the valid neighbours.
template <class T, int C>
struct ZeroEdgeSampler {
    SourceRows<T, C> rows;
    const Plx_Image *src;
    const Plx_Image *mask;
    int32_t mdx, mdy;

    ZeroEdgeSampler(const Context &ctx)
        : rows(ctx.source), src(ctx.source), mask(ctx.source_mask),
          mdx(ctx.source_mask != nullptr ? ctx.source->x - ctx.source_mask->x : 0),
          mdy(ctx.source_mask != nullptr ? ctx.source->y - ctx.source_mask->y : 0)
    {
    }

    void add(float x, float y, float *acc, float &coverage) const
    {
        // Far outside: nothing to add (and no float-to-int overflow).
        if (!(x >= -1.0f && x < float(src->width) && y >= -1.0f && y < float(src->height))) return;
        const float fx0 = std::floor(x), fy0 = std::floor(y);
        const int32_t ix = int32_t(fx0), iy = int32_t(fy0);
        const float fx = x - fx0, fy = y - fy0;
        const float weight[4] = {(1.0f - fx) * (1.0f - fy), fx * (1.0f - fy), (1.0f - fx) * fy, fx * fy};
        for (int k = 0; k < 4; ++k) {
            const int32_t cx = ix + (k & 1), cy = iy + (k >> 1);
            if (cx < 0 || cy < 0 || cx >= src->width || cy >= src->height) continue;
            if (mask != nullptr && !bit_at(mask, cy + mdy, cx + mdx)) continue;
            const auto *row = rows.row(cy);
            for (int c = 0; c < C; ++c) acc[c] += weight[k] * rows.get(row, cx, c);
            coverage += weight[k];
        }
    }
};

// The blur ellipse of an output pixel, or false for none.
bool blur_at(const Plx_Image *blur, int32_t x, int32_t y, float &a, float &b, float &c)
{
    const int32_t col = x - blur->x, row = y - blur->y;
    if (row < 0 || col < 0 || row >= blur->height || col >= blur->width) return false;
    const float *p = static_cast<const float *>(plx_image_row(blur, row)) + std::ptrdiff_t(col) * 3;
    a = p[0], b = p[1], c = p[2];
    return std::isfinite(a) && std::isfinite(b) && std::isfinite(c) && a >= 0.0f && c >= 0.0f;
}

// Local Jacobian of the mapping at an output position, by central differences.
bool local_jacobian(const Mapping &map, float x, float y, float J[2][2])
{
    float ax, ay, bx, by, cx, cy, dx, dy;
    int32_t code = 0;
    if (map_point(map, x + 0.5f, y, ax, ay, nullptr, &code) != MapResult::ok ||
        map_point(map, x - 0.5f, y, bx, by, nullptr, &code) != MapResult::ok ||
        map_point(map, x, y + 0.5f, cx, cy, nullptr, &code) != MapResult::ok ||
        map_point(map, x, y - 0.5f, dx, dy, nullptr, &code) != MapResult::ok)
        return false;
    J[0][0] = ax - bx, J[1][0] = ay - by;
    J[0][1] = cx - dx, J[1][1] = cy - dy;
    return true;
}

template <class T, int C>
void high_quality_row(Context &ctx, int32_t y, RowBuffers &rb)
{
    const ZeroEdgeSampler<T, C> sampler(ctx);
    const Plx_Image *src = ctx.source;
    constexpr bool source_alpha = C == 2 || C == 4;
    const bool output_alpha = format_info(ctx.output->format).alpha;
    const bool weigh = ctx.alpha_weighting && output_alpha;
    const int32_t n = ctx.region.width;
    for (int32_t i = 0; i < n; ++i) {
        if (rb.status[i] != kWrite) continue;
        const float x = rb.px[i], yy = rb.py[i];
        if (!(x >= -1.0f && x < float(src->width) && yy >= -1.0f && yy < float(src->height))) {
            rb.status[i] = kInvalid;
            continue;
        }
        float acc[C] = {};
        float coverage = 0.0f;
        int samples = 1;
        float a, b, c, J[2][2];
        const int32_t ox = ctx.region.x + i;
        if (ctx.blur != nullptr && blur_at(ctx.blur, ox, y, a, b, c) && a > 0.0f) {
            float xf = float(ox) + 0.5f, yf = float(y) + 0.5f;
            if (ctx.displacement != nullptr) {
                float dx, dy;
                displacement_at(ctx.displacement, ox, y, dx, dy);
                xf += dx, yf += dy;
            }
            if (!local_jacobian(ctx.map, xf, yf, J)) {
                sampler.add(x, yy, acc, coverage);
            } else {
                float det = a * c - b * b;
                if (!(det > 1e-12f * (a + c) * (a + c))) {
                    a += kLineWidening, c += kLineWidening;
                    det = a * c - b * b;
                }
                const float ia = c / det, ib = -b / det, ic = a / det;
                const float radius = std::sqrt(a + c);
                const int32_t kmax = int32_t(std::fmin(2.0f * radius, 1e6f));
                // Only rows of the grid that can meet the ellipse (|v| <= sqrt(c)) are visited,
                // and of each row only the span the quadratic allows, widened by a grid step
                // so that the exact test below decides.
                const int32_t vmax = std::min(kmax, int32_t(std::fmin(2.0f * std::sqrt(c), 1e6f)) + 1);
                samples = 0;
                bool full = false;
                for (int32_t kv = -vmax; kv <= vmax && !full; ++kv) {
                    const float v = 0.5f * float(kv);
                    const float disc = ib * ib * v * v - ia * (ic * v * v - 1.0f);
                    if (disc < 0.0f) continue;
                    const float centre = -ib * v / ia, half = std::sqrt(disc) / ia;
                    const int32_t lo = int32_t(std::fmax(float(-kmax), std::floor(2.0f * (centre - half)) - 1.0f));
                    const int32_t hi = int32_t(std::fmin(float(kmax), std::ceil(2.0f * (centre + half)) + 1.0f));
                    for (int32_t ku = lo; ku <= hi; ++ku) {
                        const float u = 0.5f * float(ku);
                        if (ia * u * u + 2.0f * ib * u * v + ic * v * v > 1.0f) continue;
                        if (samples == kMaxBlurSamples) {
                            if (!ctx.blur_warned) {
                                std::fputs("Warning: Maximum number of blur samples exceeded\n", stderr);
                                ctx.blur_warned = true;
                            }
                            full = true;
                            break;
                        }
                        sampler.add(x + J[0][0] * u + J[0][1] * v, yy + J[1][0] * u + J[1][1] * v, acc, coverage);
                        ++samples;
                    }
                }
                if (samples == 0) {
                    sampler.add(x, yy, acc, coverage);
                    samples = 1;
                }
            }
        } else {
            sampler.add(x, yy, acc, coverage);
        }
        const float norm = 1.0f / float(samples);
        for (int k = 0; k < C; ++k) acc[k] *= norm;
        coverage *= norm;
        if (weigh) {
            const float alpha = source_alpha ? acc[C - 1] : coverage;
            float factor;
            if (ctx.inverse_alpha)
                factor = ctx.divide_by_alpha ? (alpha < kMinAlpha ? kMaxAlphaFactor : (1.0f - alpha) / alpha)
                                             : 1.0f - alpha;
            else
                factor = ctx.divide_by_alpha ? 1.0f : alpha;
            for (int k = 0; k < (source_alpha ? C - 1 : C); ++k) acc[k] *= factor;
        }
        float *o = rb.pixels + std::ptrdiff_t(i) * C;
        for (int k = 0; k < C; ++k) o[k] = acc[k];
        rb.coverage[i] = coverage;
        rb.status[i] = coverage > 0.0f ? kWrite : kWriteInvalid;
    }
}

template <class T, int C>
struct HighQualityRow {
    static void run(Context &ctx, int32_t y, RowBuffers &rb) { high_quality_row<T, C>(ctx, y, rb); }
};

}  // namespace

SampleRowFn high_quality_sampler(const Plx_Image *source) { return pick_sampler<HighQualityRow>(source); }

}  // namespace plano::warp
