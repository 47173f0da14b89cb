// The pixel-match observation functions: the tracker's innermost loop. One template per
// motion model and channel count predicts a block of reference pixels from the search image
// warped by the homography state (bilinear interpolation, optional gain and offset) and
// fills the Jacobians. Everything is single precision and reads the search rows directly.
#include <cmath>
#include <cstring>

#include "plano/track_homography.h"

namespace {

enum class Warp { affine, proj, translate, trans_rot_scale, trans_scale };

template <Warp W>
constexpr uint32_t warp_params()
{
    switch (W) {
    case Warp::affine: return 6;
    case Warp::proj: return 9;
    case Warp::translate: return 2;
    case Warp::trans_rot_scale: return 4;
    case Warp::trans_scale: return 3;
    }
    return 0;
}

// The warped position q of (x, y, zh) and, when dq is given, its derivatives with respect to
// the state's parameters (dq[0] for q.x, dq[1] for q.y, each n long). False when the
// projective third coordinate vanishes (the pixel then contributes nothing).
template <Warp W>
inline bool warp_point(const float *p, float x, float y, float zh, float *q, float (*dq)[9])
{
    if constexpr (W == Warp::affine) {
        q[0] = p[0] * x + p[1] * y + p[2] * zh;
        q[1] = p[3] * x + p[4] * y + p[5] * zh;
        if (dq) {
            const float d0[6] = {x, y, zh, 0.f, 0.f, 0.f};
            const float d1[6] = {0.f, 0.f, 0.f, x, y, zh};
            std::memcpy(dq[0], d0, sizeof d0);
            std::memcpy(dq[1], d1, sizeof d1);
        }
    } else if constexpr (W == Warp::proj) {
        const float X = p[0] * x + p[1] * y + p[2] * zh;
        const float Y = p[3] * x + p[4] * y + p[5] * zh;
        const float Z = p[6] * x + p[7] * y + p[8] * zh;
        if (Z == 0.f) return false;
        const float iz = 1.f / Z;
        q[0] = zh * X * iz;
        q[1] = zh * Y * iz;
        if (dq) {
            const float a = zh * iz;
            const float bx = -q[0] * iz, by = -q[1] * iz;
            const float d0[9] = {a * x, a * y, a * zh, 0.f, 0.f, 0.f, bx * x, bx * y, bx * zh};
            const float d1[9] = {0.f, 0.f, 0.f, a * x, a * y, a * zh, by * x, by * y, by * zh};
            std::memcpy(dq[0], d0, sizeof d0);
            std::memcpy(dq[1], d1, sizeof d1);
        }
    } else if constexpr (W == Warp::translate) {
        q[0] = x + p[0] * zh;
        q[1] = y + p[1] * zh;
        if (dq) {
            dq[0][0] = zh, dq[0][1] = 0.f;
            dq[1][0] = 0.f, dq[1][1] = zh;
        }
    } else if constexpr (W == Warp::trans_rot_scale) {
        // (a, c, d, f) of [a -d c; d a f]
        q[0] = p[0] * x - p[2] * y + p[1] * zh;
        q[1] = p[2] * x + p[0] * y + p[3] * zh;
        if (dq) {
            const float d0[4] = {x, zh, -y, 0.f};
            const float d1[4] = {y, 0.f, x, zh};
            std::memcpy(dq[0], d0, sizeof d0);
            std::memcpy(dq[1], d1, sizeof d1);
        }
    } else {
        // (s, c, f) of [s 0 c; 0 s f]
        q[0] = p[0] * x + p[1] * zh;
        q[1] = p[0] * y + p[2] * zh;
        if (dq) {
            const float d0[3] = {x, zh, 0.f};
            const float d1[3] = {y, 0.f, zh};
            std::memcpy(dq[0], d0, sizeof d0);
            std::memcpy(dq[1], d1, sizeof d1);
        }
    }
    return true;
}

inline bool bit_at(const Plx_Image *mask, int32_t r, int32_t c)
{
    const auto *row = static_cast<const uint32_t *>(plx_image_row(mask, r));
    return (row[c >> 5] >> (c & 31)) & 1u;
}

// Checks the arguments shared by every pixel-match function; C is 1 or 3 channels.
template <Warp W, uint32_t C>
bool check_pixel_match(SumoStateVector **states, uint32_t n_states, const SumoVector *z,
                       const Plx_Vector *h, const char *name)
{
    if (states == nullptr || n_states == 0 || states[0] == nullptr || z == nullptr || h == nullptr ||
        z->user_data == nullptr) {
        PLX_ERR_START_AS(name, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return false;
    }
    const SumoStateVector *hs = states[0];
    const SumoStateVector *is = n_states > 1 ? states[1] : nullptr;
    if (hs->x.v.rows != warp_params<W>() || (is != nullptr && is->x.v.rows != 2)) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "state dimension", hs->x.v.rows);
        return false;
    }
    const auto *block = static_cast<const TrackPixelBlock *>(z->user_data);
    const Plx_Image *s = block->search_image;
    if (s == nullptr || (block->no_pixels > 0 && block->positions == nullptr)) {
        PLX_ERR_START_AS(name, PLX_ERROR_ILLEGAL_ARGUMENT, "block without search image or positions", 0);
        return false;
    }
    if (z->v.rows != block->no_pixels * C || h->rows != z->v.rows) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "observation size", z->v.rows);
        return false;
    }
    if (s->type != PLX_TYPE_FLOAT) {
        PLX_ERR_START_AS(name, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "search image is not float", s->type);
        return false;
    }
    const bool format_ok = C == 1 ? s->format == PLX_FORMAT_GREY
                                  : (s->format == PLX_FORMAT_RGB || s->format == PLX_FORMAT_RGBA);
    if (!format_ok) {
        PLX_ERR_START_AS(name, PLX_ERROR_ILLEGAL_ARGUMENT, "unsupported search image format", s->format);
        return false;
    }
    const Plx_Image *m = block->search_mask;
    if (m != nullptr && (m->type != PLX_TYPE_BIT || m->width != s->width || m->height != s->height)) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "search mask does not fit the image", 0);
        return false;
    }
    return true;
}

template <Warp W, uint32_t C>
Plx_Bool pixel_match(SumoStateVector **states, uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                     Plx_Matrix **jacobians, const char *name)
{
    if (!check_pixel_match<W, C>(states, n_states, z, h, name)) return PLX_FALSE;
    constexpr uint32_t n = warp_params<W>();
    const SumoStateVector *hs = states[0];
    const SumoStateVector *is = n_states > 1 ? states[1] : nullptr;
    Plx_Matrix *Jh = jacobians ? jacobians[0] : nullptr;
    Plx_Matrix *Ji = (jacobians && is != nullptr) ? jacobians[1] : nullptr;
    const uint32_t m = z->v.rows;
    if ((Jh && (Jh->rows != m || Jh->cols != n)) || (Ji && (Ji->rows != m || Ji->cols != 2))) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "Jacobian size", 0);
        return PLX_FALSE;
    }

    float p[9];
    for (uint32_t k = 0; k < n; ++k) p[k] = float(hs->x.v.data[k]);
    const float gain = is ? float(is->x.v.data[0]) : 1.f;
    const float offset = is ? float(is->x.v.data[1]) : 0.f;

    const auto *block = static_cast<const TrackPixelBlock *>(z->user_data);
    const Plx_Image *s = block->search_image;
    const Plx_Image *mask = block->search_mask;
    const uint32_t stride_px = plx_image_format_channels(s->format);
    const float wlim = float(s->width - 1), hlim = float(s->height - 1);
    const float zh = block->zh_f;
    const float *pos = block->positions;
    const double *zv = z->v.data;
    const bool want_dq = Jh != nullptr;

    float dq[2][9] = {};
    for (uint32_t i = 0; i < block->no_pixels; ++i) {
        const float x = pos[2 * i], y = pos[2 * i + 1];
        const uint32_t row0 = i * C;
        float q[2];
        bool inside = warp_point<W>(p, x, y, zh, q, want_dq ? dq : nullptr);
        const float ux = q[0] - 0.5f, uy = q[1] - 0.5f;
        // Written so that NaN lands outside as well.
        inside = inside && ux >= 0.f && ux < wlim && uy >= 0.f && uy < hlim;
        int32_t cx = 0, cy = 0;
        if (inside) {
            cx = int32_t(ux);
            cy = int32_t(uy);
            if (mask && !(bit_at(mask, cy, cx) && bit_at(mask, cy, cx + 1) && bit_at(mask, cy + 1, cx) &&
                          bit_at(mask, cy + 1, cx + 1)))
                inside = false;
        }
        if (!inside) {
            for (uint32_t ch = 0; ch < C; ++ch) {
                const uint32_t r = row0 + ch;
                h->data[r] = zv[r];
                if (Jh) std::memset(Jh->data + std::size_t(r) * n, 0, sizeof(double) * n);
                if (Ji) Ji->data[2 * r] = Ji->data[2 * r + 1] = 0.0;
            }
            continue;
        }
        const float fx = ux - float(cx), fy = uy - float(cy);
        const auto *r0 = static_cast<const float *>(plx_image_row(s, cy)) + std::size_t(cx) * stride_px;
        const auto *r1 = static_cast<const float *>(plx_image_row(s, cy + 1)) + std::size_t(cx) * stride_px;
        for (uint32_t ch = 0; ch < C; ++ch) {
            const float s00 = r0[ch], s01 = r0[stride_px + ch];
            const float s10 = r1[ch], s11 = r1[stride_px + ch];
            const float S = (1.f - fy) * ((1.f - fx) * s00 + fx * s01) + fy * ((1.f - fx) * s10 + fx * s11);
            const uint32_t r = row0 + ch;
            h->data[r] = double(gain * S + offset);
            if (Jh) {
                const float dSx = gain * ((s01 - s00) * (1.f - fy) + (s11 - s10) * fy);
                const float dSy = gain * ((s10 - s00) * (1.f - fx) + (s11 - s01) * fx);
                double *jr = Jh->data + std::size_t(r) * n;
                for (uint32_t k = 0; k < n; ++k) jr[k] = double(dSx * dq[0][k] + dSy * dq[1][k]);
            }
            if (Ji) {
                Ji->data[2 * r] = double(S);
                Ji->data[2 * r + 1] = 1.0;
            }
        }
    }
    return PLX_TRUE;
}

}  // namespace

#define PIXEL_MATCH_ENTRY(name, warp, channels)                                                 \
    PLANO_API Plx_Bool name(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,        \
                            uint32_t n_states, const SumoVector *z, Plx_Vector *h,                \
                            Plx_Matrix **jacobians)                                               \
    {                                                                                             \
        (void)sumo;                                                                               \
        (void)workspace;                                                                          \
        return pixel_match<warp, channels>(states, n_states, z, h, jacobians, #name);             \
    }

extern "C" {
PIXEL_MATCH_ENTRY(bPixelMatchAffineH, Warp::affine, 1)
PIXEL_MATCH_ENTRY(bPixelMatchProjH, Warp::proj, 1)
PIXEL_MATCH_ENTRY(bPixelMatchTranslateH, Warp::translate, 1)
PIXEL_MATCH_ENTRY(bPixelMatchTransRotScaleH, Warp::trans_rot_scale, 1)
PIXEL_MATCH_ENTRY(bPixelMatchTransScaleH, Warp::trans_scale, 1)
PIXEL_MATCH_ENTRY(bPixelMatchAffineRGBH, Warp::affine, 3)
PIXEL_MATCH_ENTRY(bPixelMatchProjRGBH, Warp::proj, 3)
PIXEL_MATCH_ENTRY(bPixelMatchTranslateRGBH, Warp::translate, 3)
}
