// The projective warp's inner pieces: the combined mapping, the per-call context, and the
// row stages (positions, sampling, conversion and writing) that every path shares.
#ifndef PLANO_SRC_IMAGE_PROJECTIVE_WARP_INTERNAL_HPP
#define PLANO_SRC_IMAGE_PROJECTIVE_WARP_INTERNAL_HPP

#include <cstdint>

#include "image/projective_warp_pixels.hpp"
#include "pellux/detail/pixel_traits.hpp"
#include "plano/projective_warp.h"

namespace plano::warp {

// What each output pixel of a row becomes.
enum Status : uint8_t {
    kSkip = 0,          // not computed (output mask), left as it was
    kWrite = 1,         // sampled and written
    kWriteInvalid = 2,  // written from a fallback (nearest pixel, nothing covered): bit cleared
    kInvalid = 3        // cannot be sampled: left as it was, bit cleared
};

// Result of mapping one point.
enum class MapResult { ok, outside, failed };

// Output pixels to source pixels, both in frame coordinates.
struct Mapping {
    int32_t kind = PROJECTIVE_WARP_IDENTITY;
    bool distorted = false;  // a camera has lens distortion: map through the camera operations
    // Pixel maps with the cameras' homogeneous scales folded in: source = (m p).xy / (m p).z
    // for p = (X, Y, 1) (kind 0), m p with the bottom row ignored (kind 1).
    float m[3][3] = {};
    double inv[3][3] = {};  // the inverse, in the same form, for clipping
    // Distorted mappings: single-precision cameras and homography for the pixels, double
    // ones (and the homography's inverse) for clipping.
    Plx_Camera_f cam_a_f{}, cam_b_f{};
    Plx_Matrix33_f h_f{};
    Plx_Camera cam_a{}, cam_b{};
    Plx_Matrix33 h{}, h_inv{};
    bool h_invertible = false;
};

// Builds the mapping (code 1 over the combination's or a camera conversion's failure).
bool build_mapping(const Plx_Camera *camera_a, const Plx_Matrix33 *homography,
                   const Plx_Camera *camera_b, Mapping &map, const char *caller);

// Maps one output-frame position; for a distorted mapping `cache` (optional) seeds the
// Newton solve of camera A's back-projection. failed: the camera's code is in *code.
MapResult map_point(const Mapping &map, float x, float y, float &sx, float &sy,
                    Plx_PositionState *cache, int32_t *code);
// Source position to output position (double, for clipping); false when it cannot be mapped.
bool unmap_point(const Mapping &map, double sx, double sy, double &x, double &y);

// Affine maps of a fast-render tile's two triangles, in tile-local pixel units (u, v) from
// its top-left corner: source = (c[0] + c[1] u + c[2] v, c[3] + c[4] u + c[5] v).
struct TileMap {
    bool ok;
    float upper[6];  // u + v < tile: corners 0, 1, 2
    float lower[6];  // the rest: corners 1, 2, 3
};

// Everything one warp call works with. Regions are in output frame coordinates.
struct Context {
    const Plx_Image *source = nullptr;
    const Plx_Image *source_mask = nullptr;   // null when absent or the source itself
    const Plx_Image *window_image = nullptr;
    Plx_Image *output = nullptr;
    const Plx_Image *output_mask = nullptr;   // null when absent or ignored
    Plx_Image *validity = nullptr;
    const Plx_Image *displacement = nullptr;
    const Plx_Image *blur = nullptr;
    Mapping map;
    Plx_Window region{};                      // pixels visited
    bool border_fill = false;
    bool high_quality = false;
    bool fast_render = false;
    int32_t tile = 16;
    bool alpha_weighting = false, inverse_alpha = false, divide_by_alpha = false;
    Correction correction;
    const ThreadHostInterface *host = nullptr;
    bool report_progress = true;
    uint64_t written = 0;
    bool blur_warned = false;
    // Fast render: the maps of the tiles of one tile row.
    TileMap *tiles = nullptr;
    int32_t tile_row = 0;
    bool tiles_valid = false;
};

// Per-row scratch: positions (source-local, minus 0.5, so integers are pixel centres),
// statuses, the sampled pixels in the source's format, their coverage (high-quality path)
// and the pixels in the output's format.
struct RowBuffers {
    float *px = nullptr, *py = nullptr;
    uint8_t *status = nullptr;
    float *pixels = nullptr;
    float *coverage = nullptr;
    float *converted = nullptr;
};

// Statuses of a row from the output mask (kSkip where it is clear) and the source positions
// of the rest (kInvalid where a point cannot be mapped). False on a camera failure (code 1
// registered under caller).
bool map_row(Context &ctx, int32_t y, RowBuffers &rb, const char *caller);
// Fast render: positions of a row through the affine maps of the tiles' triangles.
bool map_row_tiles(Context &ctx, int32_t y, RowBuffers &rb, const char *caller);

// Sampling of a row (by source type and channel count, chosen once per call).
using SampleRowFn = void (*)(Context &ctx, int32_t y, RowBuffers &rb);
// The row sampler Row<T, C>::run for the source's pixel type and channel count (null when
// there is none).
template <template <class, int> class Row>
SampleRowFn pick_sampler(const Plx_Image *source)
{
    const int channels = int(plx_image_format_channels(source->format));
    SampleRowFn fn = nullptr;
    auto by_channels = [&](auto tag) {
        using T = decltype(tag);
        switch (channels) {
        case 1: fn = Row<T, 1>::run; break;
        case 2: fn = Row<T, 2>::run; break;
        case 3: fn = Row<T, 3>::run; break;
        case 4: fn = Row<T, 4>::run; break;
        default: break;
        }
    };
    if (source->type == PLX_TYPE_BIT)
        by_channels(Bit{});
    else
        plx::dispatch_numeric_type(source->type, by_channels);
    return fn;
}

SampleRowFn bilinear_sampler(const Plx_Image *source);
SampleRowFn high_quality_sampler(const Plx_Image *source);

// Writes the row's pixels into the output, clears validity bits and counts what it wrote.
using ConvertRowFn = void (*)(const Correction &cc, int32_t n, const uint8_t *status, const float *pixels,
                              const float *coverage, float *converted);
using StoreRowFn = void (*)(Plx_Image *output, int32_t row, int32_t col, int32_t n, const uint8_t *status,
                            const float *pixels);
ConvertRowFn converter(Plx_ImageFormat source, Plx_ImageFormat output);
StoreRowFn storer(const Plx_Image *output);

// The rows of ctx.region: positions, sampling, writing, interrupt and progress. False on a
// failure (registered under caller).
bool render(Context &ctx, const char *caller);

// Reads a displacement vector at an output frame position (zero outside the field).
void displacement_at(const Plx_Image *field, int32_t x, int32_t y, float &dx, float &dy);

// The warp itself. init_validity: copy the output mask into the validity mask first (the
// threaded form does that once before its jobs). report_progress: whether to call slot 1.
struct WarpCall {
    const Plx_Image *background;
    const Plx_Image *output_mask;
    const Plx_Camera *camera_a;
    const Plx_Image *source;
    const Plx_Image *source_mask;
    const Plx_Camera *camera_b;
    const Plx_Matrix33 *homography;
    const ProjectiveWarpParams *params;
    Plx_Image *output;
    Plx_Image *validity;
    const ThreadHostInterface *host;
    uint32_t *statistics;
    bool copy_background;
    bool init_validity;
    bool report_progress;
};
bool warp(const WarpCall &call, const char *caller);

// Checks made before anything is written (registered under caller): formats, types,
// colour-correction mode, displacement and blur images, fast-render refusals.
bool check_call(const WarpCall &call, const char *caller);
// Copies the background into the output (converted) when asked and it is another image.
bool copy_background(const Plx_Image *background, Plx_Image *output, const char *caller);
// Sets the validity mask up: a copy of the output mask, or all set.
bool init_validity(const Plx_Image *output_mask, bool ignore_mask, const Plx_Image *output,
                   Plx_Image *validity, const char *caller);

}  // namespace plano::warp

#endif
