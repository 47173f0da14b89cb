// The warp's mapping from output pixels to source pixels: cameras and homography combined
// into one matrix when no lens distortion is involved, or the cameras' own point operations
// when one is.
#include <cmath>
#include <cstring>

#include "common/internal.hpp"
#include "image/projective_warp_internal.hpp"
#include "plano/fixed_corner_camera.h"

namespace plano::warp {

namespace {

// A null camera stands for pixels that are already normalised coordinates.
Plx_Camera identity_camera()
{
    Plx_Camera c;
    std::memset(&c, 0, sizeof c);
    plx_camera_build_linear(&c, 1.0, 1.0, 1.0, 0.0, 0.0);
    return c;
}

bool is_linear(const Plx_Camera *c) { return c == nullptr || plx_camera_is_linear(c); }

bool same_linear_part(const Plx_Camera &a, const Plx_Camera &b)
{
    return a.fx == b.fx && a.fy == b.fy && a.x0 == b.x0 && a.y0 == b.y0 && a.zh == b.zh && a.skew == b.skew;
}

// H = s I with s nonzero.
bool scaled_identity(const Plx_Matrix33 &H)
{
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c)
            if (r != c && H.m[r][c] != 0.0) return false;
    return H.m[0][0] == H.m[1][1] && H.m[1][1] == H.m[2][2] && H.m[0][0] != 0.0 && std::isfinite(H.m[0][0]);
}

bool is_domain_code(int32_t code)
{
    // Points the lens cannot map (no convergence, out of range) or that land at infinity.
    return code == PLX_ERROR_OUTSIDE_RANGE || code == PLX_ERROR_DIVISION_BY_ZERO;
}

}  // namespace

bool build_mapping(const Plx_Camera *camera_a, const Plx_Matrix33 *homography, const Plx_Camera *camera_b,
                   Mapping &map, const char *caller)
{
    Plx_Matrix33_f m, inv;
    int32_t kind = 0;
    if (!bCombineHomogCameras(camera_a, homography, camera_b, &m, &inv, &kind, nullptr)) {
        plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "cannot combine cameras", 0);
        return false;
    }
    map = Mapping{};
    map.kind = kind;
    map.cam_a = camera_a != nullptr ? *camera_a : identity_camera();
    map.cam_b = camera_b != nullptr ? *camera_b : identity_camera();
    const float zha = float(map.cam_a.zh), zhb = float(map.cam_b.zh);
    // Fold the homogeneous scales in, so a pixel (X, Y) maps as (X, Y, 1).
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) map.m[r][c] = m.m[r][c];
    if (kind == PROJECTIVE_WARP_PROJECTIVE) {
        for (int r = 0; r < 3; ++r) map.m[r][2] *= zha;
        for (int c = 0; c < 3; ++c) map.m[0][c] *= zhb, map.m[1][c] *= zhb;
    } else if (kind == PROJECTIVE_WARP_AFFINE) {
        const float ratio = zhb / zha;
        for (int r = 0; r < 2; ++r) {
            map.m[r][0] *= ratio;
            map.m[r][1] *= ratio;
            map.m[r][2] *= zhb;
        }
    }
    Plx_Matrix33 md, mi;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) md.m[r][c] = map.m[r][c];
    if (kind == PROJECTIVE_WARP_AFFINE) md.m[2][0] = md.m[2][1] = 0.0, md.m[2][2] = 1.0;
    if (kind == PROJECTIVE_WARP_IDENTITY) plx_mat33_ident_s(&md);
    if (!plx_mat33_invert_s(&md, &mi)) {
        plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "singular mapping", 0);
        return false;
    }
    std::memcpy(map.inv, mi.m, sizeof map.inv);

    map.distorted = !is_linear(camera_a) || !is_linear(camera_b);
    if (!map.distorted) return true;
    if (homography != nullptr)
        map.h = *homography;
    else
        plx_mat33_ident_s(&map.h);
    map.h_invertible = plx_mat33_invert_s(&map.h, &map.h_inv) != 0;
    plx_err_flush_trace();
    plx_mat33f_from_mat33(&map.h, &map.h_f);
    std::memset(&map.cam_a_f, 0, sizeof map.cam_a_f);
    std::memset(&map.cam_b_f, 0, sizeof map.cam_b_f);
    if (!gbCameraInternalize(&map.cam_a) || !gbCameraInternalize(&map.cam_b) ||
        !gbCamerafFromCamera(&map.cam_a, &map.cam_a_f, nullptr, nullptr) ||
        !gbCamerafFromCamera(&map.cam_b, &map.cam_b_f, nullptr, nullptr)) {
        plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "cannot convert cameras", 0);
        return false;
    }
    if (map.cam_a_f.point_backproject == nullptr || map.cam_b_f.point_project == nullptr) {
        plx_err_flush_trace();
        plx_err_register_fileline(caller, PLX_ERROR_NOT_INITIALISED, __FILE__, __LINE__, "camera without operations", 0);
        return false;
    }
    return true;
}

MapResult map_point(const Mapping &map, float x, float y, float &sx, float &sy, Plx_PositionState *cache,
                    int32_t *code)
{
    if (!map.distorted) {
        const auto &m = map.m;
        switch (map.kind) {
        case PROJECTIVE_WARP_IDENTITY:
            sx = x, sy = y;
            return MapResult::ok;
        case PROJECTIVE_WARP_AFFINE:
            sx = m[0][0] * x + m[0][1] * y + m[0][2];
            sy = m[1][0] * x + m[1][1] * y + m[1][2];
            return MapResult::ok;
        default: {
            const float w = m[2][0] * x + m[2][1] * y + m[2][2];
            if (!(w > 0.0f)) return MapResult::outside;
            sx = (m[0][0] * x + m[0][1] * y + m[0][2]) / w;
            sy = (m[1][0] * x + m[1][1] * y + m[1][2]) / w;
            return std::isfinite(sx) && std::isfinite(sy) ? MapResult::ok : MapResult::outside;
        }
        }
    }
    const Plx_Vector3_f pixel{x, y, map.cam_a_f.zh};
    Plx_Vector3_f ray, point, source;
    int32_t c = 0;
    if (!map.cam_a_f.point_backproject(&map.cam_a_f, &pixel, &ray, cache, &c)) {
        if (is_domain_code(c)) return MapResult::outside;
        *code = c;
        return MapResult::failed;
    }
    plx_mat33f_multv3_s(&map.h_f, &ray, &point);
    if (!(point.z > 0.0f)) return MapResult::outside;
    if (!map.cam_b_f.point_project(&map.cam_b_f, &point, &source, nullptr, nullptr, &c)) {
        if (is_domain_code(c)) return MapResult::outside;
        *code = c;
        return MapResult::failed;
    }
    if (!(source.z != 0.0f)) return MapResult::outside;
    const float scale = map.cam_b_f.zh / source.z;
    sx = source.x * scale;
    sy = source.y * scale;
    return std::isfinite(sx) && std::isfinite(sy) ? MapResult::ok : MapResult::outside;
}

bool unmap_point(const Mapping &map, double sx, double sy, double &x, double &y)
{
    if (!map.distorted) {
        const auto &v = map.inv;
        const double w = map.kind == PROJECTIVE_WARP_PROJECTIVE ? v[2][0] * sx + v[2][1] * sy + v[2][2] : 1.0;
        if (!(w > 0.0)) return false;
        x = (v[0][0] * sx + v[0][1] * sy + v[0][2]) / w;
        y = (v[1][0] * sx + v[1][1] * sy + v[1][2]) / w;
        return std::isfinite(x) && std::isfinite(y);
    }
    if (!map.h_invertible || map.cam_b.point_backproject == nullptr || map.cam_a.point_project == nullptr)
        return false;
    const Plx_Vector3 pixel{sx, sy, map.cam_b.zh};
    Plx_Vector3 ray, point, out;
    int32_t code = 0;
    if (!map.cam_b.point_backproject(&map.cam_b, &pixel, &ray, nullptr, &code)) return false;
    plx_mat33_multv3_s(&map.h_inv, &ray, &point);
    if (!(point.z > 0.0)) return false;
    if (!map.cam_a.point_project(&map.cam_a, &point, &out, nullptr, nullptr, &code) || out.z == 0.0) return false;
    x = out.x * (map.cam_a.zh / out.z);
    y = out.y * (map.cam_a.zh / out.z);
    return std::isfinite(x) && std::isfinite(y);
}

}  // namespace plano::warp

extern "C" {

PLANO_API Plx_Bool bCombineHomogCameras(const Plx_Camera *camera_a, const Plx_Matrix33 *homography,
                                        const Plx_Camera *camera_b, Plx_Matrix33_f *mapping,
                                        Plx_Matrix33_f *inverse, int32_t *kind, Plx_Bool *identity)
{
    using namespace plano::warp;
    if (mapping == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null mapping", 0);
        return 0;
    }
    const Plx_Camera a = camera_a != nullptr ? *camera_a : identity_camera();
    const Plx_Camera b = camera_b != nullptr ? *camera_b : identity_camera();
    Plx_Matrix33 H;
    if (homography != nullptr)
        H = *homography;
    else
        plx_mat33_ident_s(&H);
    const bool linear = is_linear(camera_a) && is_linear(camera_b);

    Plx_Matrix33_f m, mi;
    int32_t k;
    if (linear && scaled_identity(H) && same_linear_part(a, b)) {
        k = PROJECTIVE_WARP_IDENTITY;
        plx_mat33f_ident_s(&m);
        plx_mat33f_ident_s(&mi);
    } else {
        Plx_Matrix33 Ka, Kb, Ka_inv, HKa_inv, M;
        plx_camera_fill_fullmatrix_s(&a, &Ka);
        plx_camera_fill_fullmatrix_s(&b, &Kb);
        if (!plx_mat33_invert_s(&Ka, &Ka_inv)) {
            PLX_ERR_PASS_MSG("camera A has no inverse", 0);
            return 0;
        }
        plx_mat33_rmultm33_s(&H, &Ka_inv, &HKa_inv);
        plx_mat33_rmultm33_s(&Kb, &HKa_inv, &M);
        if (linear && M.m[2][0] == 0.0 && M.m[2][1] == 0.0) {
            const double m22 = M.m[2][2];
            if (m22 == 0.0) {
                PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "affine mapping with zero scale", 0);
                return 0;
            }
            k = PROJECTIVE_WARP_AFFINE;
            Plx_Matrix23_f A, Ai;
            for (int r = 0; r < 2; ++r)
                for (int c = 0; c < 3; ++c) A.m[r][c] = float(M.m[r][c] / m22);
            if (!plx_mat23hf_invert_q(&A, &Ai)) {
                PLX_ERR_PASS_MSG("singular mapping", 0);
                return 0;
            }
            for (int r = 0; r < 2; ++r)
                for (int c = 0; c < 3; ++c) m.m[r][c] = A.m[r][c], mi.m[r][c] = Ai.m[r][c];
            m.m[2][0] = m.m[2][1] = mi.m[2][0] = mi.m[2][1] = 0.0f;
            m.m[2][2] = mi.m[2][2] = 1.0f;
        } else {
            k = PROJECTIVE_WARP_PROJECTIVE;
            plx_mat33f_from_mat33(&M, &m);
            if (!plx_mat33f_invert(&m, &mi)) {
                PLX_ERR_PASS_MSG("singular mapping", 0);
                return 0;
            }
        }
    }
    *mapping = m;
    if (inverse != nullptr) *inverse = mi;
    if (kind != nullptr) *kind = k;
    if (identity != nullptr) *identity = k == PROJECTIVE_WARP_IDENTITY ? 1 : 0;
    return 1;
}

}  // extern "C"
