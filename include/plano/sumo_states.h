/* Standard state types of the Sumo optimiser: homographies, affine motions, 2D and 3D points,
 * 2D lines, 3D rotations and cameras.
 *
 * Each type stores a type code in the state's x.type and parameterises its object by the
 * state's parameters. For every type:
 *   Init       (sumo, state, object)  sets the code, the parameters and initialises the state;
 *              homogeneous types also get one h-type scale observation (z = 1, information
 *              1000) that holds the sum of squares of their parameters near 1. Initialising
 *              as any other type removes such an observation from the state.
 *   InitFixed  (sumo, state, object)  dimension 0; a heap copy of the object (null: none) is
 *              kept in the state's user data.
 *   InitMinimal / InitMimimal  one entry (the largest) fixed at 1 and left out.
 *   Reset      (state, object)  new parameters for the state's current code (code 12 for a
 *              code of another type, code 18 for a zero divisor); nothing for fixed codes.
 *   Read       (state, object out)  the object from the parameters or the stored copy.
 *   FillJacobian1/2/3 (J out, rows of derivatives with respect to the object's entries,
 *              scale, type code)  the rows reduced to the parameters' columns (1, 2 or 3 rows,
 *              row-major in `d`), multiplied by scale when it is not 1; J is resized to
 *              rows x dimension. FillJacobian takes an m x k matrix of such rows.
 * The Init functions give the state its dimension (shrunk in place; grown only for states on
 * the heap: a state from a memory stack that is too small is code 7). An eliminated state is
 * code 7, a non-finite object value code 32. A failing function leaves the state and its
 * outputs as they were. The F twins take and give float matrices and otherwise behave
 * identically, with the same codes. */
#ifndef PLANO_SUMO_STATES_H
#define PLANO_SUMO_STATES_H

#include "pellux/camera.h"
#include "pellux/fixed.h"
#include "pellux/matrix.h"
#include "pellux/rotation.h"
#include "plano/plano_base.h"
#include "plano/sumo.h"
#include "plano/threads.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---- type codes ---- */

#define SUMO_TYPE_POINT2D 257
#define SUMO_TYPE_POINT2DH 258
#define SUMO_TYPE_POINT2DH_FIXED 259
#define SUMO_TYPE_POINT2DH_MINIMAL0 260 /* 260 + k: coordinate k fixed at 1, k = 0..2 */
#define SUMO_TYPE_LINE2DH 513
#define SUMO_TYPE_LINE2DH_FIXED 514
#define SUMO_TYPE_POINT3D 769
#define SUMO_TYPE_POINT3D_FIXED 770
#define SUMO_TYPE_POINT3DH 771
#define SUMO_TYPE_POINT3DH_FIXED 772
#define SUMO_TYPE_POINT3DH_MINIMAL0 773 /* 773 + k, k = 0..3 */
#define SUMO_TYPE_HOMOG33 4097
#define SUMO_TYPE_HOMOG33_FIXED 4098
#define SUMO_TYPE_HOMOG33_MINIMAL0 4099 /* 4099 + k: entry k (row-major) fixed at 1, k = 0..8 */
#define SUMO_TYPE_AFFHOMOG33 4353
#define SUMO_TYPE_AFFHOMOG33_FIXED 4354
#define SUMO_TYPE_AFFHOMOG33_TRANSLATION 4355
#define SUMO_TYPE_AFFHOMOG33_TRANS_SCALE 4356
#define SUMO_TYPE_AFFHOMOG33_TRANS_ROT_SCALE 4357
#define SUMO_TYPE_ROTATE3D 4609
#define SUMO_TYPE_ROTATE3D_FIXED 4610
#define SUMO_TYPE_CAMERA_FIXED 8194            /* no parameters */
#define SUMO_TYPE_CAMERA_K1 8195               /* K1 */
#define SUMO_TYPE_CAMERA_K1K2 8196             /* K1, K2 */
#define SUMO_TYPE_CAMERA_K1K2K3 8197           /* K1, K2, K3 */
#define SUMO_TYPE_CAMERA_CENTRE_K1 8198        /* x0, y0, K1 */
#define SUMO_TYPE_CAMERA_CENTRE_K1K2 8199      /* x0, y0, K1, K2 */
#define SUMO_TYPE_CAMERA_FY_K1K2 8200          /* fy, K1, K2 */
#define SUMO_TYPE_CAMERA_FULL_K1K2 8201        /* fx, fy, x0, y0, K1, K2 */
#define SUMO_TYPE_CAMERA_XY 8202               /* cxx, cxy, cyx, cyy */
#define SUMO_TYPE_CAMERA_CENTRE_XY 8203        /* x0, y0, cxx, cxy, cyx, cyy */
/* I/O tag of camera states. */
#define SUMO_IO_TAG_CAMERA 8192

/* ---- homographies (object: 3x3 matrix; parameters: entries row-major) ---- */

PLANO_API Plx_Bool bSumoHomog33Init(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *H);
PLANO_API Plx_Bool bSumoHomog33InitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *H);
/* Fixes the largest entry (ties keep the earlier entry, except that entry 1 wins a tie with
 * entry 0); when the largest entry is 0, the most negative one by the same rule instead. */
PLANO_API Plx_Bool bSumoHomog33InitMinimal(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *H);
PLANO_API Plx_Bool bSumoHomog33Reset(SumoStateVector *state, const Plx_Matrix33 *H);
/* A fixed state without a stored matrix reads as the identity. */
PLANO_API Plx_Bool bSumoHomog33Read(const SumoStateVector *state, Plx_Matrix33 *H);
/* d: nine derivatives of one scalar (1 x n), two rows of nine (2 x n), or an m x 9 matrix. */
PLANO_API Plx_Bool bSumoHomog33FillJacobian1(Plx_Matrix *J, const double d[9], double scale, int32_t type);
PLANO_API Plx_Bool bSumoHomog33FillJacobian2(Plx_Matrix *J, const double d[18], double scale, int32_t type);
PLANO_API Plx_Bool bSumoHomog33FillJacobian(Plx_Matrix *J, const Plx_Matrix *d, double scale, int32_t type);
/* Scale function of the homogeneous types (the same for all four): h = sum of squares of the
 * state's parameters, Jacobian 2 x^T. */
PLANO_API Plx_Bool bSumoHomog33ScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                      uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians);

PLANO_API Plx_Bool bSumoHomog33FInit(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33_f *H);
PLANO_API Plx_Bool bSumoHomog33FInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33_f *H);
PLANO_API Plx_Bool bSumoHomog33FInitMinimal(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33_f *H);
PLANO_API Plx_Bool bSumoHomog33FReset(SumoStateVector *state, const Plx_Matrix33_f *H);
PLANO_API Plx_Bool bSumoHomog33FRead(const SumoStateVector *state, Plx_Matrix33_f *H);

/* ---- affine motions (object: [a b c; d e f], the top of [a b c; d e f; 0 0 1]) ---- */

PLANO_API Plx_Bool bSumoAffHomog33Init(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A);
PLANO_API Plx_Bool bSumoAffHomog33InitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A);
/* Translation (c, f) only. */
PLANO_API Plx_Bool bSumoAffHomog33InitTranslation(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A);
/* (s, c, f) with s = (a + e)/2. */
PLANO_API Plx_Bool bSumoAffHomog33InitTransScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A);
/* (a, c, d, f) with a = (a + e)/2, d = (d - b)/2. */
PLANO_API Plx_Bool bSumoAffHomog33InitTransRotScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A);
PLANO_API Plx_Bool bSumoAffHomog33Reset(SumoStateVector *state, const Plx_Matrix23 *A);
/* A fixed state without a stored matrix reads as the identity. */
PLANO_API Plx_Bool bSumoAffHomog33Read(const SumoStateVector *state, Plx_Matrix23 *A);
/* d: one row (two rows) of six derivatives over a..f; codes 4356 and 4357 are code 12. */
PLANO_API Plx_Bool bSumoAffHomog33FillJacobian1(Plx_Matrix *J, const double d[6], double scale, int32_t type);
PLANO_API Plx_Bool bSumoAffHomog33FillJacobian2(Plx_Matrix *J, const double d[12], double scale, int32_t type);

PLANO_API Plx_Bool bSumoAffHomog33FInit(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A);
PLANO_API Plx_Bool bSumoAffHomog33FInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A);
PLANO_API Plx_Bool bSumoAffHomog33FInitTranslation(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A);
PLANO_API Plx_Bool bSumoAffHomog33FInitTransScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A);
PLANO_API Plx_Bool bSumoAffHomog33FInitTransRotScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A);
PLANO_API Plx_Bool bSumoAffHomog33FReset(SumoStateVector *state, const Plx_Matrix23_f *A);
PLANO_API Plx_Bool bSumoAffHomog33FRead(const SumoStateVector *state, Plx_Matrix23_f *A);

/* ---- 2D points (x, y) ---- */

PLANO_API Plx_Bool bSumoPoint2DInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector2 *p);
PLANO_API Plx_Bool bSumoPoint2DReset(SumoStateVector *state, const Plx_Vector2 *p);
/* (x, y) of a 257 state, the dehomogenised point of the homogeneous codes (w = 0: code 18). */
PLANO_API Plx_Bool bSumoPoint2DRead(const SumoStateVector *state, Plx_Vector2 *p);
/* d: rows of two derivatives over (x, y). */
PLANO_API Plx_Bool bSumoPoint2DFillJacobian1(Plx_Matrix *J, const double d[2], double scale, int32_t type);
PLANO_API Plx_Bool bSumoPoint2DFillJacobian2(Plx_Matrix *J, const double d[4], double scale, int32_t type);

/* ---- homogeneous 2D points (x, y, w) ---- */

PLANO_API Plx_Bool bSumoPoint2DHInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p);
PLANO_API Plx_Bool bSumoPoint2DHInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p);
PLANO_API Plx_Bool bSumoPoint2DHInitMimimal(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p);
PLANO_API Plx_Bool bSumoPoint2DHReset(SumoStateVector *state, const Plx_Vector3 *p);
/* Also reads a 257 state as (x, y, 1); a fixed state without a point reads (0, 0, 1). */
PLANO_API Plx_Bool bSumoPoint2DHRead(const SumoStateVector *state, Plx_Vector3 *p);
/* d: rows of three derivatives over (x, y, w); a 257 state keeps the columns of x and y. */
PLANO_API Plx_Bool bSumoPoint2DHFillJacobian1(Plx_Matrix *J, const double d[3], double scale, int32_t type);
PLANO_API Plx_Bool bSumoPoint2DHFillJacobian2(Plx_Matrix *J, const double d[6], double scale, int32_t type);
PLANO_API Plx_Bool bPoint2DHScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                   uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians);

/* ---- homogeneous 2D lines (a, b, c): a x + b y + c w = 0 ---- */

PLANO_API Plx_Bool bSumoLine2DHInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *l);
PLANO_API Plx_Bool bSumoLine2DHInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *l);
PLANO_API Plx_Bool bSumoLine2DHReset(SumoStateVector *state, const Plx_Vector3 *l);
/* A fixed state without a line is code 31. */
PLANO_API Plx_Bool bSumoLine2DHRead(const SumoStateVector *state, Plx_Vector3 *l);
PLANO_API Plx_Bool bSumoLine2DHFillJacobian1(Plx_Matrix *J, const double d[3], double scale, int32_t type);
PLANO_API Plx_Bool bSumoLine2DHFillJacobian2(Plx_Matrix *J, const double d[6], double scale, int32_t type);
PLANO_API Plx_Bool bLine2DHScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                  uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians);

/* ---- 3D points (x, y, z) ---- */

PLANO_API Plx_Bool bSumoPoint3DInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p);
PLANO_API Plx_Bool bSumoPoint3DInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p);
PLANO_API Plx_Bool bSumoPoint3DReset(SumoStateVector *state, const Plx_Vector3 *p);
/* (x, y, z) of 769 and 770 (a fixed state without a point reads the origin), the
 * dehomogenised point of the homogeneous codes (w = 0: code 18). */
PLANO_API Plx_Bool bSumoPoint3DRead(const SumoStateVector *state, Plx_Vector3 *p);
/* d: rows of three derivatives over (x, y, z). */
PLANO_API Plx_Bool bSumoPoint3DFillJacobian1(Plx_Matrix *J, const double d[3], double scale, int32_t type);
PLANO_API Plx_Bool bSumoPoint3DFillJacobian2(Plx_Matrix *J, const double d[6], double scale, int32_t type);
PLANO_API Plx_Bool bSumoPoint3DFillJacobian3(Plx_Matrix *J, const double d[9], double scale, int32_t type);

/* ---- homogeneous 3D points (x, y, z, w) ---- */

PLANO_API Plx_Bool bSumoPoint3DHInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector4 *p);
PLANO_API Plx_Bool bSumoPoint3DHInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector4 *p);
PLANO_API Plx_Bool bSumoPoint3DHInitMimimal(Sumo *sumo, SumoStateVector *state, const Plx_Vector4 *p);
PLANO_API Plx_Bool bSumoPoint3DHReset(SumoStateVector *state, const Plx_Vector4 *p);
/* Also reads 769 and 770 states as (x, y, z, 1); a fixed state without a point reads
 * (0, 0, 0, 1). */
PLANO_API Plx_Bool bSumoPoint3DHRead(const SumoStateVector *state, Plx_Vector4 *p);
/* d: rows of four derivatives over (x, y, z, w); a 769 state keeps the columns of x, y, z. */
PLANO_API Plx_Bool bSumoPoint3DHFillJacobian1(Plx_Matrix *J, const double d[4], double scale, int32_t type);
PLANO_API Plx_Bool bSumoPoint3DHFillJacobian2(Plx_Matrix *J, const double d[8], double scale, int32_t type);
PLANO_API Plx_Bool bSumoPoint3DHFillJacobian3(Plx_Matrix *J, const double d[12], double scale, int32_t type);
PLANO_API Plx_Bool bPoint3DHScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                   uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians);

/* ---- 3D rotations ----
 * The rotation is exp([x]) R0: the parameters x are a small rotation (exponential vector)
 * applied on the left of a reference rotation R0 kept in the user data. The installed adjust
 * function folds x into R0 after every step and sets x back to zero; reinstating the old
 * parameters restores the reference of before the last fold. */

/* R must be a rotation matrix (code 32 otherwise, from the quaternion conversion). */
PLANO_API Plx_Bool bSumoRotate3DInit(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *R);
PLANO_API Plx_Bool bSumoRotate3DInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *R);
/* Zero increment around R (4609), or a new stored rotation (4610: unlike other fixed codes,
 * since the reference is what a rotation state keeps). */
PLANO_API Plx_Bool bSumoRotate3DReset(SumoStateVector *state, const Plx_Matrix33 *R);
/* A fixed state without a rotation reads as the identity. */
PLANO_API Plx_Bool bSumoRotate3DRead(const SumoStateVector *state, Plx_Matrix33 *R);
/* The adjust function installed by bSumoRotate3DInit (mode 0 folds, mode 1 restores). */
PLANO_API Plx_Bool bSumoRotate3DAdjust(Sumo *sumo, uint32_t mode, SumoStateVector *state);
/* Derivatives of the nine entries of R (row-major) with respect to the parameters at their
 * current value: J is resized to 9 x 3 (9 x 0 for a fixed rotation). */
PLANO_API Plx_Bool bSumoRotate3DJacobian(const SumoStateVector *state, Plx_Matrix *J);

/* ---- cameras ----
 * The camera record is kept in the user data; the parameters estimate the fields listed at
 * the type codes above, the other fields come from the stored camera. Radial codes accept
 * linear and radial cameras (models 0 to 3; missing coefficients are 0), x/y codes linear and
 * x/y distortion cameras (models 0 and 9), 8194 any camera; others are code 12. */

PLANO_API Plx_Bool bSumoCameraReset(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                    const Plx_Camera *camera, int32_t type);
/* The camera built from the parameters and the stored camera (radial cameras for 8195 to
 * 8201, x/y distortion cameras for 8202 and 8203, the stored camera for 8194). */
PLANO_API Plx_Bool bSumoCameraRead(const SumoStateVector *state, Plx_Camera *camera);
/* Projects the 3D point with the state's camera into pixel (u, v, zh). jacobian_point
 * (optional) is resized to 2 x 3 (d(u, v)/d(X, Y, Z)), jacobian_state (optional) to 2 x n
 * (d(u, v) with respect to the parameters). */
PLANO_API Plx_Bool bSumoCameraProjectPoint(const SumoStateVector *state, const Plx_Vector3 *point,
                                           Plx_Vector3 *pixel, Plx_Matrix *jacobian_point,
                                           Plx_Matrix *jacobian_state);
/* A new camera state in the branch, reset from the camera with the given code, labelled and
 * given I/O tag 8192; null on failure (nothing is left in the branch). */
PLANO_API SumoStateVector *pSumoCameraNew(Sumo *sumo, SumoBranch *branch, const Plx_Camera *camera, int32_t type,
                                          int32_t label, const ThreadHostInterface *host);

#ifdef __cplusplus
}
#endif

#endif
