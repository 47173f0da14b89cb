/* Fixed-corner-warp cameras: lens models that bend the image edges while the four image
 * corners stay where they are.
 *
 * They live in the ordinary camera records (type PLX_FIXED_CORNER_WARP_CAMERA = 10 and its
 * inverse PLX_FIXED_CORNER_WARP_CAMERA_INV = 11), so everything that projects through a
 * camera uses them unchanged. In normalised coordinates x = (u - x0)/fx, y = (v - y0)/fy the
 * image spans [-0.5, 0.5]^2; with a = 0.25 - x^2 and b = 0.25 - y^2 the forward warp is
 *   x' = x + 4 [b ((x + .5) k4 + (.5 - x) k2) + a ((y + .5) k7 + (.5 - y) k5)] + k9 x a + k10 y b
 *   y' = y + 4 [b ((x + .5) k3 + (.5 - x) k1) + a ((y + .5) k8 + (.5 - y) k6)] + k11 x a + k12 y b
 * so k1..k8 are the displacements of the four edge midpoints and k9..k12 bend the edges into
 * S shapes. Type 10 projects through the warp and back-projects through its inverse (a Newton
 * solve, whose starting point a caller may keep in a Plx_PositionState); type 11 is the other
 * way round. The skew field is never read.
 *
 * Internalising and converting hand every other camera type to the numerical layer; the
 * builders and the comparison refuse it with code 12. */
#ifndef PLANO_FIXED_CORNER_CAMERA_H
#define PLANO_FIXED_CORNER_CAMERA_H

#include "pellux/camera.h"
#include "plano/plano_base.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Builds a type-10 or type-11 camera; k1 .. k12 follow y0 as doubles. The record is written
 * only on success; zero fx, fy or zh fail (code 1 over the numerical layer's 18). */
PLANO_API Plx_Bool gbCameraBuildVA(Plx_Camera *camera, int32_t type, double zh, double fx,
                                   double fy, double x0, double y0, ...);
PLANO_API Plx_Bool gbCameraBuildFixedCornerWarp_f(Plx_Camera_f *camera, float zh, float fx,
                                                  float fy, float x0, float y0, float k1, float k2,
                                                  float k3, float k4, float k5, float k6, float k7,
                                                  float k8, float k9, float k10, float k11,
                                                  float k12);
PLANO_API Plx_Bool gbCameraBuildFixedCornerWarpInv_f(Plx_Camera_f *camera, float zh, float fx,
                                                     float fy, float x0, float y0, float k1,
                                                     float k2, float k3, float k4, float k5,
                                                     float k6, float k7, float k8, float k9,
                                                     float k10, float k11, float k12);

/* Re-installs the operations of a record whose fields were copied or read. */
PLANO_API Plx_Bool gbCameraInternalize(Plx_Camera *camera);
PLANO_API Plx_Bool gbCameraInternalize_f(Plx_Camera_f *camera);

/* True when type, zh, fx, fy, x0, y0 and k1..k12 are equal (NaN never equals); false with
 * code 12 when either camera is not of type 10 or 11. */
PLANO_API Plx_Bool gbCameraIdentical(const Plx_Camera *a, const Plx_Camera *b);
PLANO_API Plx_Bool gbCameraIdentical_f(const Plx_Camera_f *a, const Plx_Camera_f *b);

/* Precision conversion; clears the valid flag of each cache given (either may be null). */
PLANO_API Plx_Bool gbCamerafFromCamera(const Plx_Camera *camera, Plx_Camera_f *camera_f,
                                       Plx_PositionState *cache_a, Plx_PositionState *cache_b);
PLANO_API Plx_Bool gbCameraFromCameraf(const Plx_Camera_f *camera_f, Plx_Camera *camera,
                                       Plx_PositionState *cache_a, Plx_PositionState *cache_b);
/* By-value forms: on failure code 1 is registered and the record returned is all zero, with
 * no operations installed. */
PLANO_API Plx_Camera_f gcfCamerafFromCamera(const Plx_Camera *camera, Plx_PositionState *cache_a,
                                            Plx_PositionState *cache_b);
PLANO_API Plx_Camera gcCameraFromCameraf(const Plx_Camera_f *camera_f, Plx_PositionState *cache_a,
                                         Plx_PositionState *cache_b);

/* The operations the builders install in double-precision records of types 10 and 11 (the
 * single-precision records get internal twins that report under the same names). With an
 * error_code slot a failure writes its code there and leaves the trace alone; without one it
 * clears the trace and registers the failure. Codes: 18 for a zero fx, fy, zh, homogeneous
 * coordinate or warp Jacobian determinant, 27 when the Newton solve exceeds 100 iterations,
 * 12 for a record of another type, 32 for a null argument. */

/* Point (X, Y, Z) to pixel (u, v, zh). jacobian: d(u, v)/d(X/Z, Y/Z); deriv: two records of
 * the derivatives of u and of v with respect to the camera's fields. */
PLANO_API Plx_Bool gbPointProject(const Plx_Camera *camera, const Plx_Vector3 *point,
                                  Plx_Vector3 *pixel, Plx_Matrix22 *jacobian, Plx_Camera *deriv,
                                  int32_t *error_code);
/* Pixel (u, v, w) to the ray's point (x, y, 1). */
PLANO_API Plx_Bool gbPointBackproject(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                      Plx_Vector3 *point, Plx_PositionState *cache,
                                      int32_t *error_code);
/* Undistorted pixel to distorted pixel (third coordinate zh), and back. */
PLANO_API Plx_Bool gbPointAddDistortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                        Plx_Vector3 *distorted, Plx_PositionState *cache,
                                        int32_t *error_code);
PLANO_API Plx_Bool gbPointRemoveDistortion(const Plx_Camera *camera, const Plx_Vector3 *pixel,
                                           Plx_Vector3 *undistorted, Plx_PositionState *cache,
                                           int32_t *error_code);
/* Lines do not stay straight under these warps: both always fail (code 2; projection gives
 * 18 instead when fx, fy or zh is zero). */
PLANO_API Plx_Bool gbLineProject(const Plx_Camera *camera, const Plx_Vector3 *line,
                                 Plx_Vector3 *image_line, int32_t *error_code);
PLANO_API Plx_Bool gbLineBackproject(const Plx_Camera *camera, const Plx_Vector3 *line,
                                     Plx_Vector3 *ray_line, int32_t *error_code);

#ifdef __cplusplus
}
#endif

#endif
