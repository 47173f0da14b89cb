// The pixel-match observation functions: the tracker's innermost loop. One template per
// motion model and channel count predicts a block of reference pixels from the search image
// warped by the homography state (bilinear interpolation, optional gain and offset) and
// fills the Jacobians (image derivatives from the block's gradient images when it has them). Everything is single precision and reads the search rows directly.
// Each function is paired with the fused kernel of pixel_match_lanes.hpp, through which the
// optimiser evaluates blocks without writing their Jacobians out.
#include <cmath>
#include <cstdint>
#include <cstring>

#include "plano/track_homography.h"
#include "sumo/fused_kernels.hpp"
#include "track/pixel_match_lanes.hpp"

namespace {

using namespace plano::pixel_match;


// What the warp's derivatives at one pixel need beyond its position: for the projective
// state zh / Z and -q / Z.
struct WarpLocal {
    float x, y, a, bx, by;
};

// The warped position q of (x, y, zh), with what jacobian_row needs in l. False when the
// projective third coordinate vanishes (the pixel then contributes nothing).
template <Warp W>
inline bool warp_point(const float *p, float x, float y, float zh, float *q, WarpLocal &l)
{
    l.x = x;
    l.y = y;
    if constexpr (W == Warp::affine) {
        q[0] = p[0] * x + p[1] * y + p[2] * zh;
        q[1] = p[3] * x + p[4] * y + p[5] * zh;
    } else if constexpr (W == Warp::proj) {
        const float X = p[0] * x + p[1] * y + p[2] * zh;
        const float Y = p[3] * x + p[4] * y + p[5] * zh;
        const float Z = p[6] * x + p[7] * y + p[8] * zh;
        if (Z == 0.f) return false;
        const float iz = 1.f / Z;
        q[0] = zh * X * iz;
        q[1] = zh * Y * iz;
        l.a = zh * iz;
        l.bx = -q[0] * iz;
        l.by = -q[1] * iz;
    } else if constexpr (W == Warp::translate) {
        q[0] = x + p[0] * zh;
        q[1] = y + p[1] * zh;
    } else if constexpr (W == Warp::trans_rot_scale) {
        // (a, c, d, f) of [a -d c; d a f]
        q[0] = p[0] * x - p[2] * y + p[1] * zh;
        q[1] = p[2] * x + p[0] * y + p[3] * zh;
    } else {
        // (s, c, f) of [s 0 c; 0 s f]
        q[0] = p[0] * x + p[1] * zh;
        q[1] = p[0] * y + p[2] * zh;
    }
    return true;
}

// One Jacobian row of the prediction: the gained image derivatives (dSx, dSy) times dq/dp,
// evaluated in single precision.
template <Warp W>
inline void jacobian_row(const WarpLocal &l, float zh, float dSx, float dSy, double *j)
{
    const float x = l.x, y = l.y;
    if constexpr (W == Warp::affine) {
        j[0] = double(dSx * x), j[1] = double(dSx * y), j[2] = double(dSx * zh);
        j[3] = double(dSy * x), j[4] = double(dSy * y), j[5] = double(dSy * zh);
    } else if constexpr (W == Warp::proj) {
        const float ax = l.a * x, ay = l.a * y, az = l.a * zh;
        j[0] = double(dSx * ax), j[1] = double(dSx * ay), j[2] = double(dSx * az);
        j[3] = double(dSy * ax), j[4] = double(dSy * ay), j[5] = double(dSy * az);
        j[6] = double(dSx * (l.bx * x) + dSy * (l.by * x));
        j[7] = double(dSx * (l.bx * y) + dSy * (l.by * y));
        j[8] = double(dSx * (l.bx * zh) + dSy * (l.by * zh));
    } else if constexpr (W == Warp::translate) {
        j[0] = double(dSx * zh), j[1] = double(dSy * zh);
    } else if constexpr (W == Warp::trans_rot_scale) {
        j[0] = double(dSx * x + dSy * y), j[1] = double(dSx * zh);
        j[2] = double(dSx * -y + dSy * x), j[3] = double(dSy * zh);
    } else {
        j[0] = double(dSx * x + dSy * y), j[1] = double(dSx * zh), j[2] = double(dSy * zh);
    }
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
    const Plx_Image *gx = block->search_gradient_x, *gy = block->search_gradient_y;
    auto fits = [s](const Plx_Image *g) {
        return g->data != nullptr && g->type == PLX_TYPE_FLOAT && g->format == s->format && g->width == s->width &&
               g->height == s->height;
    };
    if ((gx == nullptr) != (gy == nullptr) || (gx != nullptr && !(fits(gx) && fits(gy)))) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "search gradients do not fit the image", 0);
        return false;
    }
    return true;
}

// Reads a block's search pixels at warped positions with the homography and illumination
// state's current values, all in single precision.
template <Warp W, uint32_t C>
class Sampler {
public:
    Sampler(const SumoStateVector *hs, const SumoStateVector *is, const TrackPixelBlock *block)
        : gain_(is ? float(is->x.v.data[0]) : 1.f),
          offset_(is ? float(is->x.v.data[1]) : 0.f),
          data_(static_cast<const char *>(block->search_image->data)),
          stride_(block->search_image->stride),
          step_(plx_image_format_channels(block->search_image->format)),
          mask_(block->search_mask),
          wlim_(float(block->search_image->width - 1)),
          hlim_(float(block->search_image->height - 1)),
          zh_(block->zh_f),
          grad_x_(block->search_gradient_x),
          grad_y_(block->search_gradient_y)
    {
        for (uint32_t k = 0; k < warp_params<W>(); ++k) p_[k] = float(hs->x.v.data[k]);
    }

    float offset() const { return offset_; }

    // Finds the bilinear footprint of the pixel at (x, y). False when the footprint leaves
    // the image or its mask.
    bool locate(float x, float y)
    {
        float q[2];
        bool inside = warp_point<W>(p_, x, y, zh_, q, local_);
        const float ux = q[0] - 0.5f, uy = q[1] - 0.5f;
        // Written so that NaN lands outside as well.
        inside = inside && ux >= 0.f && ux < wlim_ && uy >= 0.f && uy < hlim_;
        if (!inside) return false;
        const int32_t cx = int32_t(ux), cy = int32_t(uy);
        if (mask_ && !(bit_at(mask_, cy, cx) && bit_at(mask_, cy, cx + 1) && bit_at(mask_, cy + 1, cx) &&
                       bit_at(mask_, cy + 1, cx + 1)))
            return false;
        fx_ = ux - float(cx);
        fy_ = uy - float(cy);
        r0_ = reinterpret_cast<const float *>(data_ + std::ptrdiff_t(cy) * stride_) + std::size_t(cx) * step_;
        r1_ = reinterpret_cast<const float *>(data_ + std::ptrdiff_t(cy + 1) * stride_) + std::size_t(cx) * step_;
        if (grad_x_ != nullptr) {
            gx0_ = static_cast<const float *>(plx_image_row(grad_x_, cy)) + std::size_t(cx) * step_;
            gx1_ = static_cast<const float *>(plx_image_row(grad_x_, cy + 1)) + std::size_t(cx) * step_;
            gy0_ = static_cast<const float *>(plx_image_row(grad_y_, cy)) + std::size_t(cx) * step_;
            gy1_ = static_cast<const float *>(plx_image_row(grad_y_, cy + 1)) + std::size_t(cx) * step_;
        }
        return true;
    }

    // Channel ch of the located pixel: the interpolated value S and the image derivatives
    // times the gain.
    void sample(uint32_t ch, float &S, float &dSx, float &dSy) const
    {
        S = interpolate(r0_, r1_, ch);
        if (grad_x_ != nullptr) {
            dSx = gain_ * interpolate(gx0_, gx1_, ch);
            dSy = gain_ * interpolate(gy0_, gy1_, ch);
        } else {
            const float s00 = r0_[ch], s01 = r0_[step_ + ch];
            const float s10 = r1_[ch], s11 = r1_[step_ + ch];
            dSx = gain_ * ((s01 - s00) * (1.f - fy_) + (s11 - s10) * fy_);
            dSy = gain_ * ((s10 - s00) * (1.f - fx_) + (s11 - s01) * fx_);
        }
    }

    // Channel ch of an image at the located footprint (rows a and b).
    float interpolate(const float *a, const float *b, uint32_t ch) const
    {
        return (1.f - fy_) * ((1.f - fx_) * a[ch] + fx_ * a[step_ + ch]) +
               fy_ * ((1.f - fx_) * b[ch] + fx_ * b[step_ + ch]);
    }

    float predict(float S) const { return gain_ * S + offset_; }

    // The Jacobian row of the located pixel for the gained derivatives of one channel.
    void jacobian(float dSx, float dSy, double *j) const { jacobian_row<W>(local_, zh_, dSx, dSy, j); }

private:
    float p_[9];
    float gain_, offset_;
    const char *data_;
    std::ptrdiff_t stride_;
    uint32_t step_;  // floats per pixel
    const Plx_Image *mask_;
    float wlim_, hlim_, zh_;
    WarpLocal local_{};
    const Plx_Image *grad_x_, *grad_y_;
    float fx_ = 0.f, fy_ = 0.f;
    const float *r0_ = nullptr, *r1_ = nullptr;
    const float *gx0_ = nullptr, *gx1_ = nullptr, *gy0_ = nullptr, *gy1_ = nullptr;
};

template <Warp W, uint32_t C>
Plx_Bool pixel_match(SumoStateVector **states, uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                     Plx_Matrix **jacobians, const char *name)
{
    if (!check_pixel_match<W, C>(states, n_states, z, h, name)) return PLX_FALSE;
    constexpr uint32_t n = warp_params<W>();
    const SumoStateVector *is = n_states > 1 ? states[1] : nullptr;
    Plx_Matrix *Jh = jacobians ? jacobians[0] : nullptr;
    Plx_Matrix *Ji = (jacobians && is != nullptr) ? jacobians[1] : nullptr;
    const uint32_t m = z->v.rows;
    if ((Jh && (Jh->rows != m || Jh->cols != n)) || (Ji && (Ji->rows != m || Ji->cols != 2))) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "Jacobian size", 0);
        return PLX_FALSE;
    }
    const auto *block = static_cast<const TrackPixelBlock *>(z->user_data);
    Sampler<W, C> sampler(states[0], is, block);
    const float *pos = block->positions;
    const double *zv = z->v.data;

    for (uint32_t i = 0; i < block->no_pixels; ++i) {
        const uint32_t row0 = i * C;
        if (!sampler.locate(pos[2 * i], pos[2 * i + 1])) {
            for (uint32_t ch = 0; ch < C; ++ch) {
                const uint32_t r = row0 + ch;
                h->data[r] = zv[r];
                if (Jh) std::memset(Jh->data + std::size_t(r) * n, 0, sizeof(double) * n);
                if (Ji) Ji->data[2 * r] = Ji->data[2 * r + 1] = 0.0;
            }
            continue;
        }
        for (uint32_t ch = 0; ch < C; ++ch) {
            float S, dSx, dSy;
            sampler.sample(ch, S, dSx, dSy);
            const uint32_t r = row0 + ch;
            h->data[r] = double(sampler.predict(S));
            if (Jh) sampler.jacobian(dSx, dSy, Jh->data + std::size_t(r) * n);
            if (Ji) {
                Ji->data[2 * r] = double(S);
                Ji->data[2 * r + 1] = 1.0;
            }
        }
    }
    return PLX_TRUE;
}

// The fused form of pixel_match: chi-squared and the normal-equation terms of the block in
// one pass, with the prediction and derivatives in single precision. A pixel whose footprint
// leaves the search image adds nothing (zero residual, zero derivatives).
template <Warp W, uint32_t C, bool Illum>
void pixel_match_normal(const BlockArgs &args, double *chi2, double *jtnj, double *jtnr)
{
    // With a scaled identity the kernel weighs every row by 1 and the weight comes in here.
    const double s = args.info_step == 0 ? args.info[0] : 1.0;
    if (avx2_available())
        avx2::fused_block<W, C, Illum>(args, s, chi2, jtnj, jtnr);
    else
        portable::fused_block<W, C, Illum>(args, s, chi2, jtnj, jtnr);
}

template <Warp W, uint32_t C>
sumo::FusedResult pixel_match_fused(SumoStateVector **states, uint32_t n_states, const SumoVector *z,
                                    const double *info, uint32_t info_step, double *chi2, double *jtnj, double *jtnr,
                                    const char *name)
{
    // The kernel stacks the terms of the homography and illumination states only; further
    // states (which the prediction ignores) are left to the general path.
    if (n_states > 2) return sumo::FusedResult::declined;
    if (!check_pixel_match<W, C>(states, n_states, z, &z->v, name)) return sumo::FusedResult::failed;
    const auto *block = static_cast<const TrackPixelBlock *>(z->user_data);
    const Plx_Image *s = block->search_image;
    // The lanes index the search image with 32-bit offsets.
    const std::size_t floats = std::size_t(s->height) * std::size_t(s->stride) / sizeof(float);
    if (s->stride % int32_t(sizeof(float)) != 0 || floats >= std::size_t(INT32_MAX)) return sumo::FusedResult::declined;
    // The lanes read the gradients at the search image's offsets.
    const Plx_Image *gx = block->search_gradient_x, *gy = block->search_gradient_y;
    if (gx != nullptr && (gx->stride != s->stride || gy->stride != s->stride)) return sumo::FusedResult::declined;
    const SumoStateVector *is = n_states > 1 ? states[1] : nullptr;
    BlockArgs a{};
    for (uint32_t k = 0; k < warp_params<W>(); ++k) a.p[k] = float(states[0]->x.v.data[k]);
    a.gain = is ? float(is->x.v.data[0]) : 1.f;
    a.offset = is ? float(is->x.v.data[1]) : 0.f;
    a.zh = block->zh_f;
    a.data = static_cast<const float *>(s->data);
    a.grad_x = gx != nullptr ? static_cast<const float *>(gx->data) : nullptr;
    a.grad_y = gy != nullptr ? static_cast<const float *>(gy->data) : nullptr;
    a.stride = s->stride / int32_t(sizeof(float));
    a.step = int32_t(plx_image_format_channels(s->format));
    a.wlim = float(s->width - 1);
    a.hlim = float(s->height - 1);
    a.mask = block->search_mask;
    a.positions = block->positions;
    a.no_pixels = block->no_pixels;
    a.z = z->v.data;
    a.info = info;
    a.info_step = info_step;
    a.terms = jtnj != nullptr;
    if (is != nullptr)
        pixel_match_normal<W, C, true>(a, chi2, jtnj, jtnr);
    else
        pixel_match_normal<W, C, false>(a, chi2, jtnj, jtnr);
    return sumo::FusedResult::done;
}

}  // namespace

// Each entry point with its fused kernel, registered with the optimiser at load.
#define PIXEL_MATCH_ENTRY(name, warp, channels)                                                             \
    extern "C" PLANO_API Plx_Bool name(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,        \
                                       uint32_t n_states, const SumoVector *z, Plx_Vector *h,                \
                                       Plx_Matrix **jacobians)                                               \
    {                                                                                                         \
        (void)sumo;                                                                                           \
        (void)workspace;                                                                                      \
        return pixel_match<warp, channels>(states, n_states, z, h, jacobians, #name);                         \
    }                                                                                                         \
    namespace {                                                                                               \
    sumo::FusedResult name##_fused(SumoStateVector **states, uint32_t n_states, const SumoVector *z,          \
                                   const double *info, uint32_t info_step, double *chi2, double *jtnj,        \
                                   double *jtnr)                                                              \
    {                                                                                                         \
        return pixel_match_fused<warp, channels>(states, n_states, z, info, info_step, chi2, jtnj, jtnr, #name); \
    }                                                                                                         \
    const bool name##_registered = sumo::register_fused_h(name, name##_fused);                               \
    }

PIXEL_MATCH_ENTRY(bPixelMatchAffineH, Warp::affine, 1)
PIXEL_MATCH_ENTRY(bPixelMatchProjH, Warp::proj, 1)
PIXEL_MATCH_ENTRY(bPixelMatchTranslateH, Warp::translate, 1)
PIXEL_MATCH_ENTRY(bPixelMatchTransRotScaleH, Warp::trans_rot_scale, 1)
PIXEL_MATCH_ENTRY(bPixelMatchTransScaleH, Warp::trans_scale, 1)
PIXEL_MATCH_ENTRY(bPixelMatchAffineRGBH, Warp::affine, 3)
PIXEL_MATCH_ENTRY(bPixelMatchProjRGBH, Warp::proj, 3)
PIXEL_MATCH_ENTRY(bPixelMatchTranslateRGBH, Warp::translate, 3)
