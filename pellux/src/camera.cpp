// Building, internalising and converting camera records, the camera matrix and the wrappers
// over a record's operations.
#include <cmath>
#include <cstdarg>

#include "camera_internal.hpp"
#include "pellux/error.h"

namespace {

using plx::CameraTraits;

template <class T>
bool finite_fields(const typename CameraTraits<T>::Camera &c, int coeffs)
{
    bool ok = std::isfinite(c.fx) && std::isfinite(c.fy) && std::isfinite(c.skew) && std::isfinite(c.x0) &&
              std::isfinite(c.y0) && std::isfinite(c.zh);
    for (int i = 0; i < coeffs; ++i) ok = ok && std::isfinite(c.k[i]);
    return ok;
}

// Checks the fields a record of a type this library handles relies on, then installs its
// operations and copies it out; on failure dest is left as it was.
template <class T>
bool finish(typename CameraTraits<T>::Camera built, typename CameraTraits<T>::Camera *dest, const char *function)
{
    int coeffs = plx::camera_coefficient_count(built.type);
    if (coeffs < 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "camera type not handled here", built.type);
        return false;
    }
    if (!finite_fields<T>(built, coeffs)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "camera field not finite", built.type);
        return false;
    }
    if (built.fx == 0 || built.fy == 0 || built.zh == 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_DIVISION_BY_ZERO, "zero focal length or z-homogeneous coordinate", 0);
        return false;
    }
    plx::install_camera_operations<T>(&built);
    *dest = built;
    return true;
}

template <class T>
bool build(typename CameraTraits<T>::Camera *camera, int32_t type, T zh, T fx, T fy, T skew, T x0, T y0,
           const double *coeffs, int n, const char *function)
{
    if (camera == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null camera", 0);
        return false;
    }
    typename CameraTraits<T>::Camera c{};
    c.type = type;
    c.zh = zh;
    c.fx = fx;
    c.fy = fy;
    c.skew = skew;
    c.x0 = x0;
    c.y0 = y0;
    for (int i = 0; i < n; ++i) c.k[i] = static_cast<T>(coeffs[i]);
    return finish<T>(c, camera, function);
}

// The coefficients of build_va follow y0 as doubles: skew for the affine type, k[] otherwise.
template <class T>
bool build_va(typename CameraTraits<T>::Camera *camera, int32_t type, T zh, T fx, T fy, T x0, T y0,
              va_list args, const char *function)
{
    int n = plx::camera_coefficient_count(type);
    if (n < 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "camera type not handled here", type);
        return false;
    }
    double coeffs[PLX_CAMERA_MAX_COEFFS] = {};
    T skew = 0;
    if (type == PLX_AFFINE_CAMERA) skew = static_cast<T>(va_arg(args, double));
    for (int i = 0; i < n; ++i) coeffs[i] = va_arg(args, double);
    return build<T>(camera, type, zh, fx, fy, skew, x0, y0, coeffs, n, function);
}

template <class T>
bool internalize(typename CameraTraits<T>::Camera *camera, const char *function)
{
    if (camera == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null camera", 0);
        return false;
    }
    return finish<T>(*camera, camera, function);
}

template <class To, class From>
bool convert(const typename CameraTraits<From>::Camera *from, typename CameraTraits<To>::Camera *to,
             const char *function)
{
    if (from == nullptr || to == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null camera", 0);
        return false;
    }
    int coeffs = plx::camera_coefficient_count(from->type);
    if (coeffs < 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "camera type not handled here", from->type);
        return false;
    }
    typename CameraTraits<To>::Camera c{};
    c.type = from->type;
    c.fx = static_cast<To>(from->fx);
    c.fy = static_cast<To>(from->fy);
    c.skew = static_cast<To>(from->skew);
    c.x0 = static_cast<To>(from->x0);
    c.y0 = static_cast<To>(from->y0);
    c.zh = static_cast<To>(from->zh);
    for (int i = 0; i < PLX_CAMERA_MAX_COEFFS; ++i) c.k[i] = static_cast<To>(from->k[i]);
    // A double beyond the float range becomes infinite: refuse it rather than hand out a
    // camera that maps everything to infinity.
    if (finite_fields<From>(*from, coeffs) && !finite_fields<To>(c, coeffs)) {
        PLX_ERR_START_AS(function, PLX_ERROR_OUTSIDE_RANGE, "camera field beyond single precision", 0);
        return false;
    }
    return finish<To>(c, to, function);
}

Plx_Bool missing_operation(const char *function)
{
    PLX_ERR_START_AS(function, PLX_ERROR_NOT_INITIALISED, "camera or operation not set up", 0);
    return PLX_FALSE;
}

Plx_Bool passed(Plx_Bool ok, const char *function)
{
    if (!ok) plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
    return ok ? PLX_TRUE : PLX_FALSE;
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_camera_build_linear(Plx_Camera *camera, double zh, double fx, double fy, double x0, double y0)
{
    return build<double>(camera, PLX_LINEAR_CAMERA, zh, fx, fy, 0.0, x0, y0, nullptr, 0, __func__);
}

PLX_API Plx_Bool plx_camera_build_affine(Plx_Camera *camera, double zh, double fx, double fy, double skew,
                                         double x0, double y0)
{
    return build<double>(camera, PLX_AFFINE_CAMERA, zh, fx, fy, skew, x0, y0, nullptr, 0, __func__);
}

PLX_API Plx_Bool plx_camera_build_radial_1(Plx_Camera *camera, double zh, double fx, double fy, double x0,
                                           double y0, double K1)
{
    const double k[] = {K1};
    return build<double>(camera, PLX_RADIAL_CAMERA_1, zh, fx, fy, 0.0, x0, y0, k, 1, __func__);
}

PLX_API Plx_Bool plx_camera_build_radial_2(Plx_Camera *camera, double zh, double fx, double fy, double x0,
                                           double y0, double K1, double K2)
{
    const double k[] = {K1, K2};
    return build<double>(camera, PLX_RADIAL_CAMERA_2, zh, fx, fy, 0.0, x0, y0, k, 2, __func__);
}

PLX_API Plx_Bool plx_camera_build_radial_3(Plx_Camera *camera, double zh, double fx, double fy, double x0,
                                           double y0, double K1, double K2, double K3)
{
    const double k[] = {K1, K2, K3};
    return build<double>(camera, PLX_RADIAL_CAMERA_3, zh, fx, fy, 0.0, x0, y0, k, 3, __func__);
}

PLX_API Plx_Bool plx_camera_build_inv_radial(Plx_Camera *camera, double zh, double fx, double fy, double x0,
                                             double y0, double K1)
{
    const double k[] = {K1};
    return build<double>(camera, PLX_INV_RADIAL_CAMERA, zh, fx, fy, 0.0, x0, y0, k, 1, __func__);
}

PLX_API Plx_Bool plx_camera_build_xy_distortion(Plx_Camera *camera, double zh, double fx, double fy, double x0,
                                                double y0, double cxx, double cxy, double cyx, double cyy)
{
    const double k[] = {cxx, cxy, cyx, cyy};
    return build<double>(camera, PLX_XY_DISTORTION_CAMERA, zh, fx, fy, 0.0, x0, y0, k, 4, __func__);
}

PLX_API Plx_Bool plx_camera_build_va(Plx_Camera *camera, int32_t type, double zh, double fx, double fy,
                                     double x0, double y0, ...)
{
    va_list args;
    va_start(args, y0);
    bool ok = build_va<double>(camera, type, zh, fx, fy, x0, y0, args, __func__);
    va_end(args);
    return ok ? PLX_TRUE : PLX_FALSE;
}

PLX_API Plx_Bool plx_cameraf_build_va(Plx_Camera_f *camera, int32_t type, double zh, double fx, double fy,
                                      double x0, double y0, ...)
{
    va_list args;
    va_start(args, y0);
    bool ok = build_va<float>(camera, type, static_cast<float>(zh), static_cast<float>(fx), static_cast<float>(fy),
                              static_cast<float>(x0), static_cast<float>(y0), args, __func__);
    va_end(args);
    return ok ? PLX_TRUE : PLX_FALSE;
}

PLX_API Plx_Bool plx_camera_internalize(Plx_Camera *camera) { return internalize<double>(camera, __func__); }

PLX_API Plx_Bool plx_cameraf_internalize(Plx_Camera_f *camera) { return internalize<float>(camera, __func__); }

PLX_API Plx_Bool plx_cameraf_from_camera_q(const Plx_Camera *camera, Plx_Camera_f *camera_f)
{
    return convert<float, double>(camera, camera_f, __func__);
}

PLX_API Plx_Bool plx_camera_from_cameraf_q(const Plx_Camera_f *camera_f, Plx_Camera *camera)
{
    return convert<double, float>(camera_f, camera, __func__);
}

PLX_API Plx_Bool plx_camera_is_linear(const Plx_Camera *camera)
{
    return camera != nullptr && (camera->type == PLX_LINEAR_CAMERA || camera->type == PLX_AFFINE_CAMERA);
}

PLX_API void plx_camera_fill_matrix_s(const Plx_Camera *camera, Plx_Matrix33 *K)
{
    if (camera == nullptr || K == nullptr) return;
    *K = Plx_Matrix33{{{camera->fx, 0.0, camera->x0}, {0.0, camera->fy, camera->y0}, {0.0, 0.0, camera->zh}}};
}

PLX_API void plx_camera_fill_fullmatrix_s(const Plx_Camera *camera, Plx_Matrix33 *K)
{
    if (camera == nullptr || K == nullptr) return;
    *K = Plx_Matrix33{
        {{camera->fx, camera->skew, camera->x0}, {0.0, camera->fy, camera->y0}, {0.0, 0.0, camera->zh}}};
}

PLX_API Plx_Bool plx_camera_project_point(const Plx_Camera *camera, const Plx_Vector3 *point, Plx_Vector3 *pixel)
{
    if (camera == nullptr || camera->point_project == nullptr) return missing_operation(__func__);
    return passed(camera->point_project(camera, point, pixel, nullptr, nullptr, nullptr), __func__);
}

PLX_API Plx_Bool plx_camera_backproject_point(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                              Plx_Vector3 *point)
{
    if (camera == nullptr || camera->point_backproject == nullptr) return missing_operation(__func__);
    return passed(camera->point_backproject(camera, pixel, point, nullptr, nullptr), __func__);
}

PLX_API Plx_Bool plx_camera_add_distortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                           Plx_Vector3 *distorted)
{
    if (camera == nullptr || camera->point_add_distortion == nullptr) return missing_operation(__func__);
    return passed(camera->point_add_distortion(camera, pixel, distorted, nullptr, nullptr), __func__);
}

PLX_API Plx_Bool plx_camera_remove_distortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                              Plx_Vector3 *undistorted)
{
    if (camera == nullptr || camera->point_remove_distortion == nullptr) return missing_operation(__func__);
    return passed(camera->point_remove_distortion(camera, pixel, undistorted, nullptr, nullptr), __func__);
}

PLX_API Plx_Bool plx_camera_project_line(const Plx_Camera *camera, const Plx_Vector3 *line,
                                         Plx_Vector3 *image_line)
{
    if (camera == nullptr || camera->line_project == nullptr) return missing_operation(__func__);
    return passed(camera->line_project(camera, line, image_line, nullptr), __func__);
}

PLX_API Plx_Bool plx_camera_backproject_line(const Plx_Camera *camera, const Plx_Vector3 *line,
                                             Plx_Vector3 *ray_line)
{
    if (camera == nullptr || camera->line_backproject == nullptr) return missing_operation(__func__);
    return passed(camera->line_backproject(camera, line, ray_line, nullptr), __func__);
}

PLX_API Plx_Bool plx_cameraf_project_point(const Plx_Camera_f *camera, const Plx_Vector3_f *point,
                                           Plx_Vector3_f *pixel)
{
    if (camera == nullptr || camera->point_project == nullptr) return missing_operation(__func__);
    return passed(camera->point_project(camera, point, pixel, nullptr, nullptr, nullptr), __func__);
}

PLX_API Plx_Bool plx_cameraf_backproject_point(const Plx_Camera_f *camera, const Plx_Vector3_f *pixel,
                                               Plx_Vector3_f *point)
{
    if (camera == nullptr || camera->point_backproject == nullptr) return missing_operation(__func__);
    return passed(camera->point_backproject(camera, pixel, point, nullptr, nullptr), __func__);
}

}  // extern "C"
