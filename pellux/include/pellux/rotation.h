/* 3D rotations: unit quaternions, exponential (axis-angle) vectors and rotation matrices.
 *
 * A quaternion q = w + x i + y j + z k of unit length stands for the rotation by angle theta
 * about the unit axis u with (w, x, y, z) = (cos(theta/2), sin(theta/2) u); q and -q are the
 * same rotation. An exponential vector is theta u. Rotation matrices act on column vectors
 * (p' = R p). Functions taking a quaternion normalise it first; a zero or non-finite one fails
 * with code 18, any other non-finite input with code 32, as does a null argument. Outputs may
 * alias inputs and are left untouched on failure. */
#ifndef PELLUX_ROTATION_H
#define PELLUX_ROTATION_H

#include "pellux/base.h"
#include "pellux/fixed.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct Plx_Quaternion {
    double w, x, y, z;
} Plx_Quaternion;

PLX_API Plx_Bool plx_rot3D_from_quaternion_q(const Plx_Quaternion *q, Plx_Matrix33 *R);
PLX_API Plx_Bool plx_rot3D_from_exponential_q(const Plx_Vector3 *omega, Plx_Matrix33 *R);
/* Unit quaternion of a rotation matrix, with w >= 0. A matrix that is not a rotation (R^T R
 * off the identity by more than 1e-6 in any entry, or a negative determinant) fails with
 * code 32. */
PLX_API Plx_Bool plx_quaternion_from_rot3D(const Plx_Matrix33 *R, Plx_Quaternion *q);
PLX_API Plx_Bool plx_quaternion_from_exponential(const Plx_Vector3 *omega, Plx_Quaternion *q);
/* Exponential vector of the rotation, with angle in [0, pi]. */
PLX_API Plx_Bool plx_exponential_from_quaternion(const Plx_Quaternion *q, Plx_Vector3 *omega);
PLX_API Plx_Bool plx_exponential_from_rot3D(const Plx_Matrix33 *R, Plx_Vector3 *omega);
/* Hamilton product a b: the rotation b followed by a (R(ab) = R(a) R(b)). Not normalised. */
PLX_API Plx_Bool plx_quaternion_mult(const Plx_Quaternion *a, const Plx_Quaternion *b, Plx_Quaternion *ab);
PLX_API Plx_Bool plx_quaternion_normalise(const Plx_Quaternion *q, Plx_Quaternion *unit);
/* The inverse rotation of a unit quaternion (w, -x, -y, -z). */
PLX_API Plx_Bool plx_quaternion_conjugate(const Plx_Quaternion *q, Plx_Quaternion *qc);

#ifdef __cplusplus
}
#endif

#endif
