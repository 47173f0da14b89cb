// The warp's default path: source positions of a row, then a bilinear blend of each
// position's 2x2 neighbourhood when it lies wholly inside the source and its mask, or the
// nearest source pixel under the border rules.
#include <array>
#include <cmath>
#include <cstring>
#include <type_traits>

#include "common/internal.hpp"
#include "image/projective_warp_internal.hpp"
#include "image/projective_warp_bilinear_simd.hpp"

namespace plano::warp {

namespace {

template <std::size_t N>
std::array<float, N> level_table()
{
    std::array<float, N> t{};
    const double scale = double(N - 1);
    for (std::size_t i = 0; i < N; ++i) t[i] = float(double(i) / scale);
    return t;
}

}  // namespace

// Function-local statics are built once, on first use, safely across threads.
const float *lut8()
{
    static const std::array<float, 256> table = level_table<256>();
    return table.data();
}

const float *lut16()
{
    static const std::array<float, 65536> table = level_table<65536>();
    return table.data();
}

void displacement_at(const Plx_Image *field, int32_t x, int32_t y, float &dx, float &dy)
{
    dx = dy = 0.0f;
    const int32_t c = x - field->x, r = y - field->y;
    if (r < 0 || c < 0 || r >= field->height || c >= field->width) return;
    const int channels = int(plx_image_format_channels(field->format));
    const void *row = plx_image_row(field, r);
    switch (field->type) {
    case PLX_TYPE_INT: {
        const auto *p = static_cast<const int32_t *>(row) + std::ptrdiff_t(c) * channels;
        dx = float(p[0]), dy = float(p[1]);
        break;
    }
    case PLX_TYPE_FLOAT: {
        const auto *p = static_cast<const float *>(row) + std::ptrdiff_t(c) * channels;
        dx = p[0], dy = p[1];
        break;
    }
    case PLX_TYPE_DOUBLE: {
        const auto *p = static_cast<const double *>(row) + std::ptrdiff_t(c) * channels;
        dx = float(p[0]), dy = float(p[1]);
        break;
    }
    default: break;
    }
}

namespace {

// kWrite where the output mask lets a pixel be computed, kSkip elsewhere.
void mask_statuses(const Context &ctx, int32_t y, uint8_t *status)
{
    const int32_t n = ctx.region.width;
    const Plx_Image *mask = ctx.output_mask;
    if (mask == nullptr) {
        for (int32_t i = 0; i < n; ++i) status[i] = kWrite;
        return;
    }
    const int32_t r = y - mask->y, c0 = ctx.region.x - mask->x;
    for (int32_t i = 0; i < n; ++i) status[i] = bit_at(mask, r, c0 + i) ? kWrite : kSkip;
}

}  // namespace

bool map_row(Context &ctx, int32_t y, RowBuffers &rb, const char *caller)
{
    mask_statuses(ctx, y, rb.status);
    const int32_t n = ctx.region.width, x0 = ctx.region.x;
    // Source-local positions minus half a pixel: integers are pixel centres.
    const float offx = 0.5f + float(ctx.source->x), offy = 0.5f + float(ctx.source->y);
    const float yf = float(y) + 0.5f;
    float *px = rb.px, *py = rb.py;
    uint8_t *st = rb.status;
    const Mapping &map = ctx.map;
    if (!map.distorted && ctx.displacement == nullptr) {
        // The hot case: every position is a plain function of the pixel, so the loops below
        // carry no per-pixel calls and each pixel is computed on its own (results do not
        // depend on where a row or a band starts).
        const auto &m = map.m;
        if (map.kind == PROJECTIVE_WARP_IDENTITY) {
            for (int32_t i = 0; i < n; ++i) {
                px[i] = (float(x0 + i) + 0.5f) - offx;
                py[i] = yf - offy;
            }
        } else if (map.kind == PROJECTIVE_WARP_AFFINE) {
            const float bx = m[0][1] * yf + m[0][2], by = m[1][1] * yf + m[1][2];
            for (int32_t i = 0; i < n; ++i) {
                const float xf = float(x0 + i) + 0.5f;
                px[i] = (m[0][0] * xf + bx) - offx;
                py[i] = (m[1][0] * xf + by) - offy;
            }
        } else {
            const float bx = m[0][1] * yf + m[0][2], by = m[1][1] * yf + m[1][2], bw = m[2][1] * yf + m[2][2];
            bool behind = false;
            for (int32_t i = 0; i < n; ++i) {
                const float xf = float(x0 + i) + 0.5f;
                const float w = m[2][0] * xf + bw;
                const float inv = 1.0f / w;
                px[i] = (m[0][0] * xf + bx) * inv - offx;
                py[i] = (m[1][0] * xf + by) * inv - offy;
                behind |= !(w > 0.0f);
            }
            // Points at or behind the horizon have no sample.
            if (behind)
                for (int32_t i = 0; i < n; ++i)
                    if (!(m[2][0] * (float(x0 + i) + 0.5f) + bw > 0.0f) && st[i] == kWrite) st[i] = kInvalid;
        }
        return true;
    }
    // Displaced or distorted: one point at a time. The Newton start of a distorted camera is
    // kept along the row only, so a row maps the same whichever band it falls in.
    Plx_PositionState cache{};
    for (int32_t i = 0; i < n; ++i) {
        if (st[i] != kWrite) continue;
        float xf = float(x0 + i) + 0.5f, yv = yf;
        if (ctx.displacement != nullptr) {
            float dx, dy;
            displacement_at(ctx.displacement, x0 + i, y, dx, dy);
            xf += dx, yv += dy;
        }
        float sx = 0.0f, sy = 0.0f;
        int32_t code = 0;
        const MapResult r = map_point(map, xf, yv, sx, sy, map.distorted ? &cache : nullptr, &code);
        if (r == MapResult::failed) {
            plx_err_flush_trace();
            plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "camera point mapping failed",
                                      code);
            return false;
        }
        if (r == MapResult::outside) {
            st[i] = kInvalid;
            continue;
        }
        px[i] = sx - offx;
        py[i] = sy - offy;
    }
    return true;
}

namespace {

template <class T, int C>
void bilinear_row(Context &ctx, int32_t, RowBuffers &rb)
{
    const Plx_Image *src = ctx.source;
    const SourceRows<T, C> rows(src);
    const int32_t w = src->width, h = src->height;
    const float last_x = float(w - 1), last_y = float(h - 1);
    const Plx_Image *mask = ctx.source_mask;
    const int32_t mdx = mask != nullptr ? src->x - mask->x : 0, mdy = mask != nullptr ? src->y - mask->y : 0;
    const Plx_Image *win = ctx.window_image;
    const bool fallback = win != nullptr || ctx.border_fill;
    const int32_t n = ctx.region.width;
    const float *px = rb.px, *py = rb.py;
    uint8_t *st = rb.status;
    float *out = rb.pixels;
    // 8-bit and one-channel float sources without a mask: runs of eight pixels to be written whose neighbourhoods
    // are all inside go through the vector kernel (same arithmetic as the loop below).
    bool (*vector8)(const SourceBlock &, const float *, const float *, float *) = nullptr;
    const bool vector_ok = mask == nullptr && u8_bilinear_vector_available() && src->stride > 0 &&
                           int64_t(h) * src->stride < (int64_t(1) << 31);
    if constexpr (std::is_same_v<T, uint8_t> && (C == 1 || C == 3 || C == 4)) {
        if (vector_ok) vector8 = C == 1 ? u8_bilinear8_c1 : C == 3 ? u8_bilinear8_c3 : u8_bilinear8_c4;
    }
    if constexpr (std::is_same_v<T, float> && C == 1) {
        if (vector_ok) vector8 = f32_bilinear8_c1;
    }
    const SourceBlock block{static_cast<const uint8_t *>(src->data), src->stride, last_x, last_y};
    int32_t vector_end = -1;  // pixels below it were blended by the vector kernel
    for (int32_t i = 0; i < n; ++i) {
        if (vector8 != nullptr && i >= vector_end && i + 8 <= n) {
            uint64_t run;
            std::memcpy(&run, st + i, 8);
            if (run == 0x0101010101010101ull * kWrite && vector8(block, px + i, py + i, out + std::ptrdiff_t(i) * C)) {
                vector_end = i + 8;
                i += 7;
                continue;
            }
            vector_end = i + 8;  // this run goes pixel by pixel
        }
        if (st[i] != kWrite) continue;
        const float x = px[i], y = py[i];
        // The last row and column are never the top-left of a neighbourhood.
        if (x >= 0.0f && x < last_x && y >= 0.0f && y < last_y) {
            const int32_t ix = int32_t(x), iy = int32_t(y);
            if (mask == nullptr ||
                (bit_at(mask, iy + mdy, ix + mdx) && bit_at(mask, iy + mdy, ix + 1 + mdx) &&
                 bit_at(mask, iy + 1 + mdy, ix + mdx) && bit_at(mask, iy + 1 + mdy, ix + 1 + mdx))) {
                const float fx = x - float(ix), fy = y - float(iy);
                const float w00 = (1.0f - fx) * (1.0f - fy), w10 = fx * (1.0f - fy);
                const float w01 = (1.0f - fx) * fy, w11 = fx * fy;
                const auto *r0 = rows.row(iy);
                const auto *r1 = rows.row(iy + 1);
                float *o = out + std::ptrdiff_t(i) * C;
                float v[C];
                for (int c = 0; c < C; ++c) {
                    if constexpr (std::is_same_v<T, uint8_t>)
                        v[c] = blend_u8(w00, w10, w01, w11, r0[ix * C + c], r0[(ix + 1) * C + c], r1[ix * C + c],
                                        r1[(ix + 1) * C + c]);
                    else
                        v[c] = (w00 * rows.get(r0, ix, c) + w10 * rows.get(r0, ix + 1, c)) +
                               (w01 * rows.get(r1, ix, c) + w11 * rows.get(r1, ix + 1, c));
                }
                for (int c = 0; c < C; ++c) o[c] = v[c];
                continue;
            }
        }
        st[i] = kInvalid;
        if (!fallback) continue;
        // Nearest pixel: rounded by adding 0.5 and truncating, negatives outside.
        const float nx = x + 0.5f, ny = y + 0.5f;
        if (!(nx >= 0.0f && nx < float(w) && ny >= 0.0f && ny < float(h))) continue;
        const int32_t ix = int32_t(nx), iy = int32_t(ny);
        const bool allowed = (win != nullptr && bit_at(win, iy + src->y - win->y, ix + src->x - win->x)) ||
                             (ctx.border_fill && (mask == nullptr || bit_at(mask, iy + mdy, ix + mdx)));
        if (!allowed) continue;
        const auto *r0 = rows.row(iy);
        float *o = out + std::ptrdiff_t(i) * C;
        for (int c = 0; c < C; ++c) o[c] = rows.get(r0, ix, c);
        st[i] = kWriteInvalid;
    }
}

template <class T, int C>
struct BilinearRow {
    static void run(Context &ctx, int32_t y, RowBuffers &rb) { bilinear_row<T, C>(ctx, y, rb); }
};

}  // namespace

SampleRowFn bilinear_sampler(const Plx_Image *source) { return pick_sampler<BilinearRow>(source); }

}  // namespace plano::warp
