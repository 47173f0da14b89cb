// The warp's fast render: the output is covered by square tiles aligned on multiples of the
// tile size in output frame coordinates; each tile's four corners are mapped exactly and
// each of its two triangles gets the affine map through its three corners, so the pixels
// need no projective division and no camera operation. Tiles do not depend on where the
// output region or a job's band starts, so any split gives the same pixels.
#include <algorithm>
#include <cmath>

#include "common/internal.hpp"
#include "image/projective_warp_internal.hpp"

namespace plano::warp {

namespace {

int32_t floor_div(int32_t a, int32_t b) { return a >= 0 ? a / b : -((-a + b - 1) / b); }

// Maps the corners of every tile of tile row ty that the region touches. A corner that
// cannot be mapped leaves its tile without a map; a camera failure is a failed tile fill.
bool map_tile_row(Context &ctx, int32_t ty, const char *caller)
{
    const int32_t T = ctx.tile;
    const int32_t tx0 = floor_div(ctx.region.x, T), tx1 = floor_div(ctx.region.x + ctx.region.width - 1, T);
    const float inv_t = 1.0f / float(T);
    for (int32_t tx = tx0; tx <= tx1; ++tx) {
        TileMap &tile = ctx.tiles[tx - tx0];
        tile.ok = true;
        float sx[4], sy[4];
        for (int k = 0; k < 4 && tile.ok; ++k) {
            const float x = float((tx + (k & 1)) * int64_t(T)), y = float((ty + (k >> 1)) * int64_t(T));
            int32_t code = 0;
            const MapResult r = map_point(ctx.map, x, y, sx[k], sy[k], nullptr, &code);
            if (r == MapResult::failed) {
                plx_err_flush_trace();
                plx_err_register_fileline(caller, PLX_ERROR_UNSUPPORTED, __FILE__, __LINE__, "tile fill failed", code);
                return false;
            }
            tile.ok = r == MapResult::ok;
        }
        if (!tile.ok) continue;
        const float up[6] = {sx[0], (sx[1] - sx[0]) * inv_t, (sx[2] - sx[0]) * inv_t,
                             sy[0], (sy[1] - sy[0]) * inv_t, (sy[2] - sy[0]) * inv_t};
        const float lo[6] = {sx[1] + sx[2] - sx[3], (sx[3] - sx[2]) * inv_t, (sx[3] - sx[1]) * inv_t,
                             sy[1] + sy[2] - sy[3], (sy[3] - sy[2]) * inv_t, (sy[3] - sy[1]) * inv_t};
        for (int k = 0; k < 6; ++k) tile.upper[k] = up[k], tile.lower[k] = lo[k];
    }
    ctx.tile_row = ty;
    ctx.tiles_valid = true;
    return true;
}

}  // namespace

bool map_row_tiles(Context &ctx, int32_t y, RowBuffers &rb, const char *caller)
{
    const int32_t T = ctx.tile;
    const int32_t ty = floor_div(y, T);
    if ((!ctx.tiles_valid || ctx.tile_row != ty) && !map_tile_row(ctx, ty, caller)) return false;
    // Statuses from the output mask, as for the other paths.
    const int32_t n = ctx.region.width, x0 = ctx.region.x;
    const Plx_Image *mask = ctx.output_mask;
    for (int32_t i = 0; i < n; ++i)
        rb.status[i] = mask == nullptr || bit_at(mask, y - mask->y, x0 + i - mask->x) ? kWrite : kSkip;
    const float offx = 0.5f + float(ctx.source->x), offy = 0.5f + float(ctx.source->y);
    const int32_t tx0 = floor_div(x0, T);
    const float v = float(y - ty * T) + 0.5f;
    const float t = float(T);
    for (int32_t i = 0; i < n;) {
        const int32_t tx = floor_div(x0 + i, T);
        const int32_t end = std::min(n, (tx + 1) * T - x0);
        const TileMap &tile = ctx.tiles[tx - tx0];
        if (!tile.ok) {
            for (; i < end; ++i)
                if (rb.status[i] == kWrite) rb.status[i] = kInvalid;
            continue;
        }
        // Pixel centres with u + v < tile take the upper triangle: u < tile - v, so the
        // row of the tile splits into two plain runs.
        const int32_t first_lower = std::clamp(tx * T - x0 + int32_t(std::ceil(t - v - 0.5f)), i, end);
        for (int half = 0; half < 2; ++half) {
            const float *c = half == 0 ? tile.upper : tile.lower;
            const int32_t stop = half == 0 ? first_lower : end;
            const float bx = c[2] * v + c[0], by = c[5] * v + c[3];
            const float base = float(tx * T - x0) - 0.5f;
            for (; i < stop; ++i) {
                const float u = float(i) - base;
                rb.px[i] = (c[1] * u + bx) - offx;
                rb.py[i] = (c[4] * u + by) - offy;
            }
        }
    }
    return true;
}

}  // namespace plano::warp
