// Single warped samples (for callers that need one at a time) and the flow field a
// homography between two cameras induces.
#include <cmath>
#include <cstring>

#include "common/internal.hpp"
#include "pellux/detail/precision.hpp"
#include "image/projective_warp_internal.hpp"

namespace {

template <class S>
using Precision = plx::Precision<S>;

// Reports a failure into the caller's slot when one is given, else into the trace.
Plx_Bool report(int32_t *error_code, const char *name, int32_t code, const char *message)
{
    if (error_code != nullptr) {
        *error_code = code;
    } else if (code != 0) {
        plx_err_flush_trace();
        plx_err_register_fileline(name, code, __FILE__, __LINE__, message, 0);
    }
    return 0;
}

// Stored value of a pixel channel, normalised to full scale 1 for the unsigned types.
template <class S, class T>
S normalised(T v)
{
    if constexpr (std::is_same_v<T, uint8_t>) return S(v) / S(255);
    if constexpr (std::is_same_v<T, uint16_t>) return S(v) / S(65535);
    if constexpr (std::is_same_v<T, uint32_t>) return S(double(v) / 4294967295.0);
    return S(v);
}

template <class S>
Plx_Bool pixel_warp(S x, S y, const Plx_Image *source, const Plx_Image *mask,
                    const typename Precision<S>::Camera *camera, const typename Precision<S>::Mat33 *H,
                    const Plx_Image *displacement, S *result, int32_t *error_code, const char *name)
{
    using Vec3 = typename Precision<S>::Vec3;
    if (source == nullptr || result == nullptr)
        return report(error_code, name, PLX_ERROR_ILLEGAL_ARGUMENT, "null source or result");
    const int channels = plano::warp::format_info(source->format).channels;
    if (channels == 0) return report(error_code, name, PLX_ERROR_ILLEGAL_FORMAT, "source format not supported");
    if (source->type < PLX_TYPE_UCHAR || source->type > PLX_TYPE_DOUBLE)
        return report(error_code, name, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "source pixel type not supported");
    if (mask == source) mask = nullptr;
    if (mask != nullptr && mask->type != PLX_TYPE_BIT)
        return report(error_code, name, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "mask is not a bit image");
    if (displacement != nullptr) {
        if (displacement->format != PLX_FORMAT_VECTOR2D)
            return report(error_code, name, PLX_ERROR_ILLEGAL_FORMAT, "displacement is not a 2D field");
        if (displacement->type != PLX_TYPE_INT && displacement->type != PLX_TYPE_FLOAT &&
            displacement->type != PLX_TYPE_DOUBLE)
            return report(error_code, name, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "displacement type not supported");
        if (std::isfinite(double(x)) && std::isfinite(double(y)) && std::fabs(double(x)) < 2e9 &&
            std::fabs(double(y)) < 2e9) {
            float dx, dy;
            plano::warp::displacement_at(displacement, int32_t(std::floor(x)), int32_t(std::floor(y)), dx, dy);
            x += S(dx), y += S(dy);
        }
    }
    Vec3 p{x, y, S(1)};
    if (H != nullptr) {
        const auto &m = H->m;
        p = Vec3{m[0][0] * x + m[0][1] * y + m[0][2], m[1][0] * x + m[1][1] * y + m[1][2],
                 m[2][0] * x + m[2][1] * y + m[2][2]};
    }
    S u, v;
    if (camera != nullptr) {
        if (camera->point_project == nullptr)
            return report(error_code, name, PLX_ERROR_NOT_INITIALISED, "camera without operations");
        Vec3 pixel;
        int32_t code = 0;
        if (!camera->point_project(camera, &p, &pixel, nullptr, nullptr, &code) || pixel.z == S(0))
            return report(error_code, name, code != 0 ? code : PLX_ERROR_DIVISION_BY_ZERO, "projection failed");
        u = pixel.x * (camera->zh / pixel.z);
        v = pixel.y * (camera->zh / pixel.z);
    } else {
        if (p.z == S(0)) return report(error_code, name, PLX_ERROR_DIVISION_BY_ZERO, "point at infinity");
        u = p.x / p.z;
        v = p.y / p.z;
    }
    const S sx = u - S(0.5) - S(source->x), sy = v - S(0.5) - S(source->y);
    // The 2x2 neighbourhood must lie inside the source (and its mask): no sample otherwise.
    if (!(sx >= S(0) && sx < S(source->width - 1) && sy >= S(0) && sy < S(source->height - 1)))
        return report(error_code, name, 0, "");
    const int32_t ix = int32_t(sx), iy = int32_t(sy);
    if (mask != nullptr) {
        const int32_t mx = ix + source->x - mask->x, my = iy + source->y - mask->y;
        if (!plano::warp::bit_at(mask, my, mx) || !plano::warp::bit_at(mask, my, mx + 1) ||
            !plano::warp::bit_at(mask, my + 1, mx) || !plano::warp::bit_at(mask, my + 1, mx + 1))
            return report(error_code, name, 0, "");
    }
    const S fx = sx - S(ix), fy = sy - S(iy);
    const S w[4] = {(1 - fx) * (1 - fy), fx * (1 - fy), (1 - fx) * fy, fx * fy};
    plx::dispatch_numeric_type(source->type, [&](auto tag) {
        using T = decltype(tag);
        const T *r0 = static_cast<const T *>(plx_image_row(source, iy)) + std::ptrdiff_t(ix) * channels;
        const T *r1 = static_cast<const T *>(plx_image_row(source, iy + 1)) + std::ptrdiff_t(ix) * channels;
        for (int c = 0; c < channels; ++c)
            result[c] = w[0] * normalised<S>(r0[c]) + w[1] * normalised<S>(r0[channels + c]) +
                        w[2] * normalised<S>(r1[c]) + w[3] * normalised<S>(r1[channels + c]);
    });
    if (error_code != nullptr) *error_code = 0;
    return 1;
}

template <class T>
void store_flow(Plx_Image *flow, int32_t r, int32_t c, double dx, double dy)
{
    T *p = static_cast<T *>(plx_image_row(flow, r)) + std::ptrdiff_t(c) * 2;
    p[0] = plano::warp::store_value<T>(float(dx));
    p[1] = plano::warp::store_value<T>(float(dy));
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bImagePixelProjectiveWarp(double x, double y, const Plx_Image *source, const Plx_Image *source_mask,
                                             const Plx_Camera *camera, const Plx_Matrix33 *homography,
                                             const Plx_Image *displacement, double *result, int32_t *error_code)
{
    return pixel_warp<double>(x, y, source, source_mask, camera, homography, displacement, result, error_code,
                              __func__);
}

PLANO_API Plx_Bool bImagePixelProjectiveWarpFloat(float x, float y, const Plx_Image *source,
                                                  const Plx_Image *source_mask, const Plx_Camera_f *camera,
                                                  const Plx_Matrix33_f *homography, const Plx_Image *displacement,
                                                  float *result, int32_t *error_code)
{
    return pixel_warp<float>(x, y, source, source_mask, camera, homography, displacement, result, error_code,
                             __func__);
}

PLANO_API Plx_Bool bHomogToFlow(const Plx_Image *mask, const Plx_Camera *camera_a, const Plx_Matrix33 *homography,
                                const Plx_Camera *camera_b, Plx_Image *flow)
{
    using namespace plano::warp;
    if (mask == nullptr || flow == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null mask or flow", 0);
        return 0;
    }
    if (mask->type != PLX_TYPE_BIT) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "mask is not a bit image", mask->type);
        return 0;
    }
    const bool unformed = flow->format == PLX_FORMAT_NONE || flow->data == nullptr;
    if (!unformed && flow->format != PLX_FORMAT_VECTOR2D) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "flow is not a 2D field", flow->format);
        return 0;
    }
    if (!unformed && flow->type != PLX_TYPE_INT && flow->type != PLX_TYPE_FLOAT && flow->type != PLX_TYPE_DOUBLE) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "flow type not supported", flow->type);
        return 0;
    }
    Mapping map;
    if (!build_mapping(camera_a, homography, camera_b, map, __func__)) return 0;
    Plx_Window active;
    if (!plx_image_get_active_subwindow_b(mask, &active)) {
        PLX_ERR_PASS();
        return 0;
    }
    // Map every point first, so that a failure leaves the flow as it was.
    const std::size_t count = std::size_t(active.width) * std::size_t(active.height);
    plx::HeapPtr<float> moved(PLX_ALLOC(float, 2 * count));
    if (!moved) return 0;
    Plx_PositionState cache{};
    for (int32_t r = 0; r < active.height; ++r) {
        cache.valid = 0;
        for (int32_t c = 0; c < active.width; ++c) {
            const int32_t mr = active.y + r, mc = active.x + c;
            if (!bit_at(mask, mr, mc)) continue;
            const float xf = float(mc + mask->x) + 0.5f, yf = float(mr + mask->y) + 0.5f;
            float sx = xf, sy = yf;
            if (!map.distorted && map.kind == PROJECTIVE_WARP_PROJECTIVE) {
                const auto &m = map.m;
                const float w = m[2][0] * xf + m[2][1] * yf + m[2][2];
                if (w == 0.0f) {
                    PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "point mapped to infinity", 0);
                    return 0;
                }
                sx = (m[0][0] * xf + m[0][1] * yf + m[0][2]) / w;
                sy = (m[1][0] * xf + m[1][1] * yf + m[1][2]) / w;
            } else {
                int32_t code = 0;
                if (map_point(map, xf, yf, sx, sy, &cache, &code) != MapResult::ok) {
                    PLX_ERR_START(PLX_ERROR_CALLEE, "camera point mapping failed", code);
                    return 0;
                }
            }
            const std::size_t k = 2 * (std::size_t(r) * std::size_t(active.width) + std::size_t(c));
            moved.get()[k] = sx - xf;
            moved.get()[k + 1] = sy - yf;
        }
    }
    if (unformed) {
        if (!plx_image_set_gen(flow, PLX_FORMAT_VECTOR2D, PLX_TYPE_FLOAT, mask->height, mask->width) ||
            !plx_image_fill_zero(flow)) {
            PLX_ERR_PASS();
            return 0;
        }
        flow->x = mask->x;
        flow->y = mask->y;
    }
    for (int32_t r = 0; r < active.height; ++r)
        for (int32_t c = 0; c < active.width; ++c) {
            const int32_t mr = active.y + r, mc = active.x + c;
            if (!bit_at(mask, mr, mc)) continue;
            const int32_t fr = mr + mask->y - flow->y, fc = mc + mask->x - flow->x;
            if (fr < 0 || fc < 0 || fr >= flow->height || fc >= flow->width) continue;
            const std::size_t k = 2 * (std::size_t(r) * std::size_t(active.width) + std::size_t(c));
            const double dx = moved.get()[k], dy = moved.get()[k + 1];
            if (flow->type == PLX_TYPE_INT)
                store_flow<int32_t>(flow, fr, fc, dx, dy);
            else if (flow->type == PLX_TYPE_FLOAT)
                store_flow<float>(flow, fr, fc, dx, dy);
            else
                store_flow<double>(flow, fr, fc, dx, dy);
        }
    return 1;
}

}  // extern "C"
