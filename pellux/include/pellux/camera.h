/* Cameras.
 *
 * A camera maps a 3D point (X, Y, Z) in its own frame to an image point and back. Image
 * points are homogeneous pixels (u, v, w) standing for the pixel (zh*u/w, zh*v/w), where zh is
 * the camera's z-homogeneous coordinate: projection returns (u, v, zh). Back-projection
 * returns the ray's point (x, y, 1) on the plane Z = 1.
 *
 * The linear part: u = fx*x + skew*y + x0, v = fy*y + y0 for normalised coordinates (x, y),
 * which are x = X/Z, y = Y/Z (the affine camera takes x = X, y = Y and ignores Z). Distortion
 * acts on the normalised coordinates of pixels taken with w = zh, y = (v - y0)/fy and
 * x = (u - x0 - skew*y)/fx (skew is 0 unless set by the affine builder or by the caller):
 *   radial 1..3:     d = 1 + K1 r^2 + K2 r^4 + K3 r^6, (x, y) -> (x d, y d), r^2 = x^2 + y^2
 *   inverse radial:  the inverse of radial 1: removing distortion is (x, y) -> (x d, y d)
 *   x/y distortion:  (x, y) -> (x (1 + cxx x^2 + cxy y^2), y (1 + cyx x^2 + cyy y^2))
 * Adding distortion maps an undistorted pixel to where the lens puts it; removing is its
 * inverse, solved by Newton iteration where no closed form exists (at most 100 steps; not
 * converging, or converging beyond the radius where the lens folds back on itself, is
 * code 27; a singular Jacobian code 18). Projection adds distortion and back-projection
 * removes it. Linear and affine cameras map lines exactly (K^-T to the image, K^T back, K the
 * full camera matrix); through distortion lines bend, so the line operations of distorted
 * types fail with code 2 (line projection with code 18 first when fx, fy or zh is zero).
 * Zero divisors (Z, w, fx, fy, zh) are code 18, null arguments code 32.
 *
 * Every record carries six operations that the builder installs; callers use them through
 * the plx_camera_* wrappers or directly. A record whose fields were copied or read from a file
 * gets its operations back from plx_camera_internalize (the engine's own types have their own
 * entry point). Types unknown to this library fail with code 12; the cubic B-spline types are
 * reserved and not handled yet (code 12). */
#ifndef PELLUX_CAMERA_H
#define PELLUX_CAMERA_H

#include "pellux/base.h"
#include "pellux/fixed.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef enum Plx_CameraType {
    PLX_LINEAR_CAMERA = 0,
    PLX_RADIAL_CAMERA_1 = 1,
    PLX_RADIAL_CAMERA_2 = 2,
    PLX_RADIAL_CAMERA_3 = 3,
    PLX_INV_RADIAL_CAMERA = 4,
    PLX_AFFINE_CAMERA = 5,
    PLX_CUBIC_BSPLINE_CAMERA = 6,
    PLX_CUBIC_BSPLINE_CAMERA_INV = 7,
    PLX_XY_DISTORTION_CAMERA = 9,
    PLX_FIXED_CORNER_WARP_CAMERA = 10,
    PLX_FIXED_CORNER_WARP_CAMERA_INV = 11
} Plx_CameraType;

#define PLX_CAMERA_MAX_COEFFS 12

/* Starting point kept between calls of an iterative point operation: a filled cache starts the
 * Newton solve from its solution (the solve is repeated from the default start when that
 * fails); every successful solve fills it. The solution is in normalised coordinates. */
typedef struct Plx_PositionState {
    int32_t valid;        /* 1 when filled */
    double point[3];      /* the last input point */
    double solution[3];   /* its solution (x, y, 1.0) */
} Plx_PositionState;

typedef struct Plx_Camera Plx_Camera;
typedef struct Plx_Camera_f Plx_Camera_f;

/* The six operations. An error_code slot, when given, receives the failure code and the trace
 * is left alone (the slot is not written on success); without it the operation clears the
 * trace and registers the failure. Outputs are written only on success and may alias inputs.
 * point_project: jacobian (optional) receives d(u, v)/d(X/Z, Y/Z) (affine: d(u, v)/d(X, Y));
 * deriv (optional, two records) receives the derivatives of u and of v with respect to each
 * camera field, laid out as camera records with the camera's type, zero where a field has no
 * effect and null operations. */
typedef Plx_Bool (*Plx_PointProjectFunc)(const Plx_Camera *camera, const Plx_Vector3 *point,
                                         Plx_Vector3 *pixel, Plx_Matrix22 *jacobian,
                                         Plx_Camera *deriv, int32_t *error_code);
typedef Plx_Bool (*Plx_PointMapFunc)(const Plx_Camera *camera, const Plx_Vector3 *in,
                                     Plx_Vector3 *out, Plx_PositionState *cache,
                                     int32_t *error_code);
typedef Plx_Bool (*Plx_LineMapFunc)(const Plx_Camera *camera, const Plx_Vector3 *line,
                                    Plx_Vector3 *out, int32_t *error_code);

typedef Plx_Bool (*Plx_PointProjectFunc_f)(const Plx_Camera_f *camera, const Plx_Vector3_f *point,
                                           Plx_Vector3_f *pixel, Plx_Matrix22_f *jacobian,
                                           Plx_Camera_f *deriv, int32_t *error_code);
typedef Plx_Bool (*Plx_PointMapFunc_f)(const Plx_Camera_f *camera, const Plx_Vector3_f *in,
                                       Plx_Vector3_f *out, Plx_PositionState *cache,
                                       int32_t *error_code);
typedef Plx_Bool (*Plx_LineMapFunc_f)(const Plx_Camera_f *camera, const Plx_Vector3_f *line,
                                      Plx_Vector3_f *out, int32_t *error_code);

struct Plx_Camera {
    int32_t type;        /* Plx_CameraType */
    double fx, fy;       /* focal lengths in pixels */
    double skew;
    double x0, y0;       /* principal point */
    double zh;           /* z-homogeneous coordinate of image points */
    /* radial: K1, K2, K3; inverse radial: K1; x/y distortion: cxx, cxy, cyx, cyy;
     * the engine's fixed-corner types: k1 .. k12 */
    double k[PLX_CAMERA_MAX_COEFFS];
    Plx_PointProjectFunc point_project;
    Plx_PointMapFunc point_backproject;
    Plx_PointMapFunc point_add_distortion;
    Plx_PointMapFunc point_remove_distortion;
    Plx_LineMapFunc line_project;
    Plx_LineMapFunc line_backproject;
};

struct Plx_Camera_f {
    int32_t type;
    float fx, fy;
    float skew;
    float x0, y0;
    float zh;
    float k[PLX_CAMERA_MAX_COEFFS];
    Plx_PointProjectFunc_f point_project;
    Plx_PointMapFunc_f point_backproject;
    Plx_PointMapFunc_f point_add_distortion;
    Plx_PointMapFunc_f point_remove_distortion;
    Plx_LineMapFunc_f line_project;
    Plx_LineMapFunc_f line_backproject;
};

/* ---- builders (fx, fy and zh must be nonzero: code 18) ---- */
PLX_API Plx_Bool plx_camera_build_linear(Plx_Camera *camera, double zh, double fx, double fy,
                                         double x0, double y0);
/* Affine camera: u = fx X + skew Y + x0, v = fy Y + y0 (no division by Z). */
PLX_API Plx_Bool plx_camera_build_affine(Plx_Camera *camera, double zh, double fx, double fy,
                                         double skew, double x0, double y0);
PLX_API Plx_Bool plx_camera_build_radial_1(Plx_Camera *camera, double zh, double fx, double fy,
                                           double x0, double y0, double K1);
PLX_API Plx_Bool plx_camera_build_radial_2(Plx_Camera *camera, double zh, double fx, double fy,
                                           double x0, double y0, double K1, double K2);
PLX_API Plx_Bool plx_camera_build_radial_3(Plx_Camera *camera, double zh, double fx, double fy,
                                           double x0, double y0, double K1, double K2, double K3);
PLX_API Plx_Bool plx_camera_build_inv_radial(Plx_Camera *camera, double zh, double fx, double fy,
                                             double x0, double y0, double K1);
PLX_API Plx_Bool plx_camera_build_xy_distortion(Plx_Camera *camera, double zh, double fx,
                                                double fy, double x0, double y0, double cxx,
                                                double cxy, double cyx, double cyy);
/* Any type this library handles, coefficients following y0 as doubles (as many as the type
 * has; the affine type takes skew). Non-finite fields fail with code 32. The single-precision
 * builder takes doubles too, since a variable-argument list cannot follow a float. */
PLX_API Plx_Bool plx_camera_build_va(Plx_Camera *camera, int32_t type, double zh, double fx,
                                     double fy, double x0, double y0, ...);
PLX_API Plx_Bool plx_cameraf_build_va(Plx_Camera_f *camera, int32_t type, double zh, double fx,
                                      double fy, double x0, double y0, ...);

/* Re-installs the operations from the stored fields, checked as the builders check them. */
PLX_API Plx_Bool plx_camera_internalize(Plx_Camera *camera);
PLX_API Plx_Bool plx_cameraf_internalize(Plx_Camera_f *camera);
/* Precision conversion of the types this library handles; a field beyond the float range is
 * code 27. */
PLX_API Plx_Bool plx_cameraf_from_camera_q(const Plx_Camera *camera, Plx_Camera_f *camera_f);
PLX_API Plx_Bool plx_camera_from_cameraf_q(const Plx_Camera_f *camera_f, Plx_Camera *camera);
/* True when the camera has no distortion (linear or affine). */
PLX_API Plx_Bool plx_camera_is_linear(const Plx_Camera *camera);

/* Upper-triangular camera matrix without skew: [[fx, 0, x0], [0, fy, y0], [0, 0, zh]]. */
PLX_API void plx_camera_fill_matrix_s(const Plx_Camera *camera, Plx_Matrix33 *K);
/* Full camera matrix: [[fx, skew, x0], [0, fy, y0], [0, 0, zh]]. */
PLX_API void plx_camera_fill_fullmatrix_s(const Plx_Camera *camera, Plx_Matrix33 *K);

/* Wrappers over the record's operations (a null camera or operation fails with code 31). */
PLX_API Plx_Bool plx_camera_project_point(const Plx_Camera *camera, const Plx_Vector3 *point,
                                          Plx_Vector3 *pixel);
PLX_API Plx_Bool plx_camera_backproject_point(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                              Plx_Vector3 *point);
PLX_API Plx_Bool plx_camera_add_distortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                           Plx_Vector3 *distorted);
PLX_API Plx_Bool plx_camera_remove_distortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                              Plx_Vector3 *undistorted);
PLX_API Plx_Bool plx_camera_project_line(const Plx_Camera *camera, const Plx_Vector3 *line,
                                         Plx_Vector3 *image_line);
PLX_API Plx_Bool plx_camera_backproject_line(const Plx_Camera *camera, const Plx_Vector3 *line,
                                             Plx_Vector3 *ray_line);
PLX_API Plx_Bool plx_cameraf_project_point(const Plx_Camera_f *camera, const Plx_Vector3_f *point,
                                           Plx_Vector3_f *pixel);
PLX_API Plx_Bool plx_cameraf_backproject_point(const Plx_Camera_f *camera,
                                               const Plx_Vector3_f *pixel, Plx_Vector3_f *point);

#ifdef __cplusplus
}
#endif

#endif
