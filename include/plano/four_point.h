/* Four-point homographies: corner pins, affine fits, projective centres and twist tests.
 *
 * Points are homogeneous (x, y, w). A quadrilateral is four corners stored in the order of
 * the unit square's (0, 0), (1, 0), (0, 1), (1, 1), so its boundary runs 0 -> 1 -> 3 -> 2.
 * Scene points may be pixels of a camera: when a camera is given they are back-projected
 * through it first, which removes its lens distortion. Outputs are written only on success. */
#ifndef PLANO_FOUR_POINT_H
#define PLANO_FOUR_POINT_H

#include "pellux/camera.h"
#include "pellux/fixed.h"
#include "plano/plano_base.h"

#ifdef __cplusplus
extern "C" {
#endif

/* H mapping each texture point onto its scene point, after the scene points have been
 * back-projected through camera (optional) and mapped by G^-1 (optional). Exact through the
 * unit square; a degenerate quadrilateral falls back to a normalised direct linear fit. H is
 * signed so that no texture point lands behind the camera; an orientation that differs
 * between the corners fails with code 7. */
PLANO_API Plx_Bool bTex2Scene(const Plx_Vector3 scene[4], const Plx_Vector3 texture[4],
                              const Plx_Matrix33 *G, const Plx_Camera *camera, Plx_Matrix33 *H);
/* Least-squares affine map from n >= 3 texture points to the (back-projected) scene points;
 * H's last row is (0, 0, 1). */
PLANO_API Plx_Bool bTex2SceneAffine(const Plx_Vector3 *scene, const Plx_Vector3 *texture,
                                    uint32_t n, const Plx_Camera *camera, Plx_Matrix33 *H);
/* Image of the centre of the quadrilateral's own plane, which is where its diagonals cross
 * (homogeneous; a pixel of camera when one is given, else in the scene points' frame). */
PLANO_API Plx_Bool bComputeProjectiveCentre(const Plx_Vector3 scene[4], const Plx_Camera *camera,
                                            Plx_Vector3 *centre);
/* True when the corners (in the order above) do not form a convex shape of one orientation. */
PLANO_API Plx_Bool bCornerPointsTwisted(float x0, float y0, float x1, float y1, float x2, float y2,
                                        float x3, float y3);

#ifdef __cplusplus
}
#endif

#endif
