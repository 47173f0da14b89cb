// Camera types 10 and 11: the point and line operations installed in their records, and the
// entry points that build, re-internalise, compare and convert cameras, each written once
// over the record's scalar type.
#include <cmath>
#include <cstdarg>
#include <cstring>
#include <limits>

#include "common/internal.hpp"
#include "pellux/detail/precision.hpp"
#include "paint/fixed_corner_warp.hpp"
#include "plano/fixed_corner_camera.h"

namespace {

using plano::fcw::Jac;
using plano::fcw::Point;

template <class S>
using Rec = plx::Precision<S>;
template <class S>
using CameraT = typename Rec<S>::Camera;
template <class S>
using Vec3T = typename Rec<S>::Vec3;

// Names under which both precisions report, so a trace reads the same for either record.
constexpr const char *kProject = "gbPointProject";
constexpr const char *kBackproject = "gbPointBackproject";
constexpr const char *kAddDistortion = "gbPointAddDistortion";
constexpr const char *kRemoveDistortion = "gbPointRemoveDistortion";
constexpr const char *kLineProject = "gbLineProject";
constexpr const char *kLineBackproject = "gbLineBackproject";

bool is_fixed_corner(int32_t type)
{
    return type == PLX_FIXED_CORNER_WARP_CAMERA || type == PLX_FIXED_CORNER_WARP_CAMERA_INV;
}

// Point operations report into the caller's slot when one is given, so a caller probing many
// points (a warp, a solver) keeps its own trace; otherwise they start a fresh trace.
// A null message picks the usual one for the code.
Plx_Bool op_fail(int32_t *slot, const char *name, int32_t code, const char *message, int line)
{
    if (message == nullptr) {
        switch (code) {
        case PLX_ERROR_ILLEGAL_ARGUMENT: message = "null argument"; break;
        case PLX_ERROR_ILLEGAL_TYPE: message = "not a fixed-corner camera"; break;
        case PLX_ERROR_DIVISION_BY_ZERO: message = "singular warp Jacobian"; break;
        case PLX_ERROR_OUTSIDE_RANGE: message = "inverse warp did not converge"; break;
        default: message = ""; break;
        }
    }
    if (slot != nullptr) {
        *slot = code;
    } else {
        plx_err_flush_trace();
        plx_err_register_fileline(name, code, __FILE__, line, message, 0);
    }
    return 0;
}
#define OP_FAIL(code, message) op_fail(error_code, name, (code), (message), __LINE__)

// Null arguments and foreign types, common to every operation; 0 when the camera is usable.
template <class Camera>
int32_t check_camera(const Camera *camera, const void *in, const void *out)
{
    if (camera == nullptr || in == nullptr || out == nullptr) return PLX_ERROR_ILLEGAL_ARGUMENT;
    if (!is_fixed_corner(camera->type)) return PLX_ERROR_ILLEGAL_TYPE;
    return 0;
}

// Applies the warp in the direction that adds distortion (forward for type 10, the Newton
// inverse for type 11) or the one that removes it.
template <class S, class Vec3>
int warp(const CameraT<S> *camera, bool distort, Point<S> in, Plx_PositionState *cache,
         const Vec3 &input, Point<S> &out)
{
    if (distort == (camera->type == PLX_FIXED_CORNER_WARP_CAMERA)) {
        out = plano::fcw::forward(camera->k, in.x, in.y);
        return 0;
    }
    return plano::fcw::inverse(camera->k, in, cache, input, out);
}

// Derivatives of u and v with respect to the camera's fields, laid out as two camera records.
// J is d(q)/d(in); coefficient derivatives of the forward warp are its basis functions at the
// warp's input, those of the inverse follow implicitly as dq/dk = -J dW/dk.
template <class S>
void fill_derivatives(const CameraT<S> *camera, Point<S> at, Point<S> q, const Jac<S> &J,
                      bool inverse, CameraT<S> *deriv)
{
    using plano::fcw::kXTerms;
    using plano::fcw::kYTerms;
    S g[6];
    plano::fcw::basis(at.x, at.y, g);
    const S scale[2] = {camera->fx, camera->fy};
    for (int r = 0; r < 2; ++r) {
        CameraT<S> &D = deriv[r];
        std::memset(&D, 0, sizeof D);
        D.type = camera->type;
        if (r == 0) {
            D.fx = q.x;
            D.x0 = S(1);
        } else {
            D.fy = q.y;
            D.y0 = S(1);
        }
        for (int j = 0; j < 6; ++j) {
            if (inverse) {
                D.k[kXTerms[j]] = -scale[r] * J.m[r][0] * g[j];
                D.k[kYTerms[j]] = -scale[r] * J.m[r][1] * g[j];
            } else {
                D.k[(r == 0 ? kXTerms : kYTerms)[j]] = scale[r] * g[j];
            }
        }
    }
}

template <class S>
Plx_Bool point_project(const CameraT<S> *camera, const Vec3T<S> *point, Vec3T<S> *pixel,
                       typename Rec<S>::Mat22 *jacobian, CameraT<S> *deriv, int32_t *error_code)
{
    const char *name = kProject;
    if (int32_t code = check_camera(camera, point, pixel)) return OP_FAIL(code, nullptr);
    const bool inverse = camera->type == PLX_FIXED_CORNER_WARP_CAMERA_INV;
    const S Z = point->z;
    if (Z == S(0)) return OP_FAIL(PLX_ERROR_DIVISION_BY_ZERO, "point at Z = 0");
    if (inverse && (camera->fx == S(0) || camera->fy == S(0) || camera->zh == S(0)))
        return OP_FAIL(PLX_ERROR_DIVISION_BY_ZERO, "zero fx, fy or zh");
    Point<S> in{point->x, point->y};
    if (Z != S(1)) in = Point<S>{in.x / Z, in.y / Z};

    Point<S> q;
    if (int code = warp<S>(camera, true, in, nullptr, *point, q)) return OP_FAIL(code, nullptr);
    if (jacobian != nullptr || deriv != nullptr) {
        // d(q)/d(in), and the point where the coefficient derivatives are taken: for type 10
        // q is the warp of in; for type 11 in is the warp of q, so the derivatives invert.
        Jac<S> J;
        const Point<S> at = inverse ? q : in;
        plano::fcw::forward(camera->k, at.x, at.y, &J);
        if (inverse) {
            const S d = J.det();
            if (d == S(0)) return OP_FAIL(PLX_ERROR_DIVISION_BY_ZERO, nullptr);
            J = Jac<S>{{{J.m[1][1] / d, -J.m[0][1] / d}, {-J.m[1][0] / d, J.m[0][0] / d}}};
        }
        if (jacobian != nullptr) {
            const S scale[2] = {camera->fx, camera->fy};
            for (int r = 0; r < 2; ++r)
                for (int c = 0; c < 2; ++c) jacobian->m[r][c] = scale[r] * J.m[r][c];
        }
        if (deriv != nullptr) fill_derivatives<S>(camera, at, q, J, inverse, deriv);
    }
    *pixel = Vec3T<S>{q.x * camera->fx + camera->x0, q.y * camera->fy + camera->y0, camera->zh};
    return 1;
}

// The three operations that take a pixel: normalise it, warp it one way or the other, and
// return either the ray's point (x, y, 1) or a pixel with third coordinate zh.
template <class S>
Plx_Bool map_pixel(const CameraT<S> *camera, const Vec3T<S> *pixel, Vec3T<S> *out,
                   Plx_PositionState *cache, int32_t *error_code, const char *name, bool distort,
                   bool to_pixel)
{
    if (int32_t code = check_camera(camera, pixel, out)) return OP_FAIL(code, nullptr);
    const S w = pixel->z, h = camera->zh;
    if (w == S(0)) return OP_FAIL(PLX_ERROR_DIVISION_BY_ZERO, "pixel at infinity");
    if (camera->fx == S(0) || camera->fy == S(0) || h == S(0))
        return OP_FAIL(PLX_ERROR_DIVISION_BY_ZERO, "zero fx, fy or zh");
    const Point<S> in{(h * pixel->x - w * camera->x0) / (w * camera->fx),
                      (h * pixel->y - w * camera->y0) / (w * camera->fy)};
    Point<S> q;
    if (int code = warp<S>(camera, distort, in, cache, *pixel, q)) return OP_FAIL(code, nullptr);
    if (to_pixel)
        *out = Vec3T<S>{q.x * camera->fx + camera->x0, q.y * camera->fy + camera->y0, h};
    else
        *out = Vec3T<S>{q.x, q.y, S(1)};
    return 1;
}

template <class S>
Plx_Bool point_backproject(const CameraT<S> *camera, const Vec3T<S> *pixel, Vec3T<S> *point,
                           Plx_PositionState *cache, int32_t *error_code)
{
    return map_pixel<S>(camera, pixel, point, cache, error_code, kBackproject, false, false);
}

template <class S>
Plx_Bool point_add_distortion(const CameraT<S> *camera, const Vec3T<S> *pixel, Vec3T<S> *out,
                              Plx_PositionState *cache, int32_t *error_code)
{
    return map_pixel<S>(camera, pixel, out, cache, error_code, kAddDistortion, true, true);
}

template <class S>
Plx_Bool point_remove_distortion(const CameraT<S> *camera, const Vec3T<S> *pixel, Vec3T<S> *out,
                                 Plx_PositionState *cache, int32_t *error_code)
{
    return map_pixel<S>(camera, pixel, out, cache, error_code, kRemoveDistortion, false, true);
}

// Straight lines bend under the warp, so neither line operation exists for these types.
template <class S>
Plx_Bool line_project(const CameraT<S> *camera, const Vec3T<S> *line, Vec3T<S> *out,
                      int32_t *error_code)
{
    const char *name = kLineProject;
    if (int32_t code = check_camera(camera, line, out)) return OP_FAIL(code, nullptr);
    if (camera->fx == S(0) || camera->fy == S(0) || camera->zh == S(0))
        return OP_FAIL(PLX_ERROR_DIVISION_BY_ZERO, "zero fx, fy or zh");
    return OP_FAIL(PLX_ERROR_UNSUPPORTED, "lines do not stay straight");
}

template <class S>
Plx_Bool line_backproject(const CameraT<S> *camera, const Vec3T<S> *line, Vec3T<S> *out,
                          int32_t *error_code)
{
    const char *name = kLineBackproject;
    if (int32_t code = check_camera(camera, line, out)) return OP_FAIL(code, nullptr);
    return OP_FAIL(PLX_ERROR_UNSUPPORTED, "lines do not stay straight");
}

// ---- what differs between the precisions: the numerical layer's entry points ----

bool build_common(Plx_Camera *c, double zh, double fx, double fy, double x0, double y0)
{
    return plx_camera_build_linear(c, zh, fx, fy, x0, y0);
}
bool build_common(Plx_Camera_f *c, float zh, float fx, float fy, float x0, float y0)
{
    return plx_cameraf_build_va(c, PLX_LINEAR_CAMERA, zh, fx, fy, x0, y0);
}
bool library_internalize(Plx_Camera *c) { return plx_camera_internalize(c); }
bool library_internalize(Plx_Camera_f *c) { return plx_cameraf_internalize(c); }
bool library_convert(const Plx_Camera *from, Plx_Camera_f *to) { return plx_cameraf_from_camera_q(from, to); }
bool library_convert(const Plx_Camera_f *from, Plx_Camera *to) { return plx_camera_from_cameraf_q(from, to); }

void install(Plx_Camera *c)
{
    c->point_project = gbPointProject;
    c->point_backproject = gbPointBackproject;
    c->point_add_distortion = gbPointAddDistortion;
    c->point_remove_distortion = gbPointRemoveDistortion;
    c->line_project = gbLineProject;
    c->line_backproject = gbLineBackproject;
}
void install(Plx_Camera_f *c)
{
    c->point_project = point_project<float>;
    c->point_backproject = point_backproject<float>;
    c->point_add_distortion = point_add_distortion<float>;
    c->point_remove_distortion = point_remove_distortion<float>;
    c->line_project = line_project<float>;
    c->line_backproject = line_backproject<float>;
}

template <class Camera>
using ScalarOf = decltype(Camera::fx);

// Failures of the entry points, registered under the public name they were called by.
Plx_Bool start_as(const char *name, int32_t code, const char *message, int line)
{
    plx_err_flush_trace();
    plx_err_register_fileline(name, code, __FILE__, line, message, 0);
    return 0;
}
Plx_Bool pass_as(const char *name, int line)
{
    plx_err_register_fileline(name, PLX_ERROR_CALLEE, __FILE__, line, "", 0);
    return 0;
}
#define START_AS(code, message) start_as(name, (code), (message), __LINE__)
#define PASS_AS() pass_as(name, __LINE__)

// Builds into a local record so the caller's is written only on success.
template <class Camera, class S = ScalarOf<Camera>>
Plx_Bool build(Camera *camera, int32_t type, S zh, S fx, S fy, S x0, S y0, const S *k,
               const char *name)
{
    if (camera == nullptr) return START_AS(PLX_ERROR_ILLEGAL_ARGUMENT, "null camera");
    if (!is_fixed_corner(type)) return START_AS(PLX_ERROR_ILLEGAL_TYPE, "not a fixed-corner type");
    for (int i = 0; i < PLX_CAMERA_MAX_COEFFS; ++i)
        if (!std::isfinite(k[i])) return START_AS(PLX_ERROR_ILLEGAL_ARGUMENT, "non-finite coefficient");
    Camera built;
    std::memset(&built, 0, sizeof built);
    if (!build_common(&built, zh, fx, fy, x0, y0)) return PASS_AS();
    built.type = type;
    std::memcpy(built.k, k, sizeof built.k);
    install(&built);
    *camera = built;
    return 1;
}

template <class Camera>
Plx_Bool internalize(Camera *camera, const char *name)
{
    if (camera == nullptr) return START_AS(PLX_ERROR_ILLEGAL_ARGUMENT, "null camera");
    if (!is_fixed_corner(camera->type)) {
        if (!library_internalize(camera)) return PASS_AS();
        return 1;
    }
    Camera rebuilt;
    if (!build(&rebuilt, camera->type, camera->zh, camera->fx, camera->fy, camera->x0, camera->y0,
               camera->k, name))
        return 0;
    rebuilt.skew = camera->skew;
    *camera = rebuilt;
    return 1;
}

template <class Camera>
Plx_Bool identical(const Camera *a, const Camera *b, const char *name)
{
    if (a == nullptr || b == nullptr) return START_AS(PLX_ERROR_ILLEGAL_ARGUMENT, "null camera");
    if (!is_fixed_corner(a->type) || !is_fixed_corner(b->type))
        return START_AS(PLX_ERROR_ILLEGAL_TYPE, "not a fixed-corner type");
    // Plain == throughout: a NaN anywhere makes the cameras differ.
    bool same = a->type == b->type && a->zh == b->zh && a->fx == b->fx && a->fy == b->fy &&
                a->x0 == b->x0 && a->y0 == b->y0;
    for (int i = 0; same && i < PLX_CAMERA_MAX_COEFFS; ++i) same = a->k[i] == b->k[i];
    return same ? 1 : 0;
}

template <class From, class To>
Plx_Bool convert(const From *from, To *to, Plx_PositionState *cache_a, Plx_PositionState *cache_b,
                 const char *name)
{
    // The caches hold solutions of the old record's precision: drop them first, whatever
    // happens next.
    if (cache_a != nullptr) cache_a->valid = 0;
    if (cache_b != nullptr) cache_b->valid = 0;
    if (from == nullptr || to == nullptr) return START_AS(PLX_ERROR_ILLEGAL_ARGUMENT, "null camera");
    using T = ScalarOf<To>;
    To converted;
    std::memset(&converted, 0, sizeof converted);
    if (is_fixed_corner(from->type)) {
        // A finite double beyond the float range would turn into an infinity.
        const double fields[] = {from->zh, from->fx, from->fy, from->skew, from->x0, from->y0};
        bool in_range = true;
        for (double v : fields) in_range = in_range && !(std::fabs(v) > std::numeric_limits<T>::max());
        for (auto v : from->k) in_range = in_range && !(std::fabs(double(v)) > std::numeric_limits<T>::max());
        if (!in_range) return START_AS(PLX_ERROR_OUTSIDE_RANGE, "field beyond the float range");
        T k[PLX_CAMERA_MAX_COEFFS];
        for (int i = 0; i < PLX_CAMERA_MAX_COEFFS; ++i) k[i] = T(from->k[i]);
        if (!build(&converted, from->type, T(from->zh), T(from->fx), T(from->fy), T(from->x0),
                   T(from->y0), k, name))
            return 0;
        converted.skew = T(from->skew);
    } else if (!library_convert(from, &converted)) {
        return PASS_AS();
    }
    *to = converted;
    return 1;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool gbPointProject(const Plx_Camera *camera, const Plx_Vector3 *point,
                                  Plx_Vector3 *pixel, Plx_Matrix22 *jacobian, Plx_Camera *deriv,
                                  int32_t *error_code)
{
    return point_project<double>(camera, point, pixel, jacobian, deriv, error_code);
}

PLANO_API Plx_Bool gbPointBackproject(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                      Plx_Vector3 *point, Plx_PositionState *cache,
                                      int32_t *error_code)
{
    return point_backproject<double>(camera, pixel, point, cache, error_code);
}

PLANO_API Plx_Bool gbPointAddDistortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                        Plx_Vector3 *distorted, Plx_PositionState *cache,
                                        int32_t *error_code)
{
    return point_add_distortion<double>(camera, pixel, distorted, cache, error_code);
}

PLANO_API Plx_Bool gbPointRemoveDistortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                           Plx_Vector3 *undistorted, Plx_PositionState *cache,
                                           int32_t *error_code)
{
    return point_remove_distortion<double>(camera, pixel, undistorted, cache, error_code);
}

PLANO_API Plx_Bool gbLineProject(const Plx_Camera *camera, const Plx_Vector3 *line,
                                 Plx_Vector3 *image_line, int32_t *error_code)
{
    return line_project<double>(camera, line, image_line, error_code);
}

PLANO_API Plx_Bool gbLineBackproject(const Plx_Camera *camera, const Plx_Vector3 *line,
                                     Plx_Vector3 *ray_line, int32_t *error_code)
{
    return line_backproject<double>(camera, line, ray_line, error_code);
}

PLANO_API Plx_Bool gbCameraBuildVA(Plx_Camera *camera, int32_t type, double zh, double fx,
                                   double fy, double x0, double y0, ...)
{
    const char *name = __func__;
    if (camera == nullptr) return START_AS(PLX_ERROR_ILLEGAL_ARGUMENT, "null camera");
    // Another type's arguments are not ours to read.
    if (!is_fixed_corner(type)) return START_AS(PLX_ERROR_ILLEGAL_TYPE, "not a fixed-corner type");
    double k[PLX_CAMERA_MAX_COEFFS];
    va_list args;
    va_start(args, y0);
    for (double &ki : k) ki = va_arg(args, double);
    va_end(args);
    return build(camera, type, zh, fx, fy, x0, y0, k, name);
}

PLANO_API Plx_Bool gbCameraBuildFixedCornerWarp_f(Plx_Camera_f *camera, float zh, float fx,
                                                  float fy, float x0, float y0, float k1, float k2,
                                                  float k3, float k4, float k5, float k6, float k7,
                                                  float k8, float k9, float k10, float k11,
                                                  float k12)
{
    const float k[PLX_CAMERA_MAX_COEFFS] = {k1, k2, k3, k4, k5, k6, k7, k8, k9, k10, k11, k12};
    return build(camera, PLX_FIXED_CORNER_WARP_CAMERA, zh, fx, fy, x0, y0, k, __func__);
}

PLANO_API Plx_Bool gbCameraBuildFixedCornerWarpInv_f(Plx_Camera_f *camera, float zh, float fx,
                                                     float fy, float x0, float y0, float k1,
                                                     float k2, float k3, float k4, float k5,
                                                     float k6, float k7, float k8, float k9,
                                                     float k10, float k11, float k12)
{
    const float k[PLX_CAMERA_MAX_COEFFS] = {k1, k2, k3, k4, k5, k6, k7, k8, k9, k10, k11, k12};
    return build(camera, PLX_FIXED_CORNER_WARP_CAMERA_INV, zh, fx, fy, x0, y0, k, __func__);
}

PLANO_API Plx_Bool gbCameraInternalize(Plx_Camera *camera) { return internalize(camera, __func__); }

PLANO_API Plx_Bool gbCameraInternalize_f(Plx_Camera_f *camera) { return internalize(camera, __func__); }

PLANO_API Plx_Bool gbCameraIdentical(const Plx_Camera *a, const Plx_Camera *b)
{
    return identical(a, b, __func__);
}

PLANO_API Plx_Bool gbCameraIdentical_f(const Plx_Camera_f *a, const Plx_Camera_f *b)
{
    return identical(a, b, __func__);
}

PLANO_API Plx_Bool gbCamerafFromCamera(const Plx_Camera *camera, Plx_Camera_f *camera_f,
                                       Plx_PositionState *cache_a, Plx_PositionState *cache_b)
{
    return convert(camera, camera_f, cache_a, cache_b, __func__);
}

PLANO_API Plx_Bool gbCameraFromCameraf(const Plx_Camera_f *camera_f, Plx_Camera *camera,
                                       Plx_PositionState *cache_a, Plx_PositionState *cache_b)
{
    return convert(camera_f, camera, cache_a, cache_b, __func__);
}

PLANO_API Plx_Camera_f gcfCamerafFromCamera(const Plx_Camera *camera, Plx_PositionState *cache_a,
                                            Plx_PositionState *cache_b)
{
    Plx_Camera_f converted;
    std::memset(&converted, 0, sizeof converted);
    if (!gbCamerafFromCamera(camera, &converted, cache_a, cache_b)) PLX_ERR_PASS();
    return converted;
}

PLANO_API Plx_Camera gcCameraFromCameraf(const Plx_Camera_f *camera_f, Plx_PositionState *cache_a,
                                         Plx_PositionState *cache_b)
{
    Plx_Camera converted;
    std::memset(&converted, 0, sizeof converted);
    if (!gbCameraFromCameraf(camera_f, &converted, cache_a, cache_b)) PLX_ERR_PASS();
    return converted;
}

}  // extern "C"
