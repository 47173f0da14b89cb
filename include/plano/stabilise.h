/* Stabilisation: smoothing a shot's homographies into stabilising corrections, the
 * components and fractional powers of homographies behind it, anchor-frame lists, and the
 * largest common inner box of the stabilised frames.
 *
 * A host stabilises a clip in three calls: abParseStringOfFrames turns the user's anchor list
 * into flags, bSmoothHomographies turns the tracked per-frame homographies H_i into
 * stabilising ones S_i, and bComputeInnerBox finds the crop inside a coverage bit image of
 * the re-rendered frames. Each frame's motion is split into a smooth reference motion R_i,
 * which passes exactly through the anchor frames (fractional matrix powers between them),
 * and a residual H_i R_i^-1; the residual's chosen components are flattened or smoothed and
 * S_i = (smoothed residual) R_i. Warping frame i by S_i H_i^-1 (from the frame to the
 * stabilised frame) removes the unwanted motion; its inverse puts work done on the stable
 * plate back on the moving one.
 *
 * Homographies are Plx_Matrix33 (row-major doubles), one per frame, consecutive. Failures are
 * reported through the error trace; outputs (and the caller's reference arrays) are written
 * only on success. */
#ifndef PLANO_STABILISE_H
#define PLANO_STABILISE_H

#include "pellux/fixed.h"
#include "pellux/image.h"
#include "plano/plano_base.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Component indices of HomographyComponents and the mask bit each one answers to. */
enum {
    PLANO_COMPONENT_ROTATION = 0,      /* radians in [-pi, pi], mask 4 */
    PLANO_COMPONENT_X_TRANSLATION = 1, /* mask 1 */
    PLANO_COMPONENT_Y_TRANSLATION = 2, /* mask 2 */
    PLANO_COMPONENT_SCALE = 3,         /* geometric, mask 8 */
    PLANO_COMPONENT_SHEAR = 4,         /* mask 16 */
    PLANO_COMPONENT_ASPECT = 5,        /* mask 32 */
    PLANO_COMPONENT_PERSPECTIVE_X = 6, /* mask 64 */
    PLANO_COMPONENT_PERSPECTIVE_Y = 7, /* mask 128 */
    PLANO_COMPONENT_COUNT = 8
};
enum {
    PLANO_MASK_X_TRANSLATION = 1,
    PLANO_MASK_Y_TRANSLATION = 2,
    PLANO_MASK_ROTATION = 4,
    PLANO_MASK_SCALE = 8,
    PLANO_MASK_SHEAR = 16,
    PLANO_MASK_ASPECT = 32,
    PLANO_MASK_PERSPECTIVE_X = 64,
    PLANO_MASK_PERSPECTIVE_Y = 128
};

/* The eight components of a homography, in the order of the indices above. With A the
 * top-left block after removing translation t and perspective g (all divided by h22) and
 * conjugated by the reference rotation: A = scale * R(rotation) * [[1, shear], [0, aspect]]. */
typedef struct HomographyComponents {
    double c[PLANO_COMPONENT_COUNT];
} HomographyComponents;

/* Fractional powers M^t of one matrix, cached. root[k] = M^(1/2^(L-k)) for k = 0..L
 * (root[L] = M); power[j] = M^(j/2^L) for j = 0..2^L, valid where computed[j] is nonzero
 * (the identity and M from the start). Start from bMatrix33GeneralRootInit; release with
 * vMatrix33GeneralRootFree. */
typedef struct Matrix33GeneralRoot {
    uint32_t no_levels;     /* L */
    Plx_Matrix33 *root;     /* L + 1 entries */
    Plx_Matrix33 *power;    /* 2^L + 1 entries */
    uint8_t *computed;      /* 2^L + 1 flags */
} Matrix33GeneralRoot;

/* Flags for frames first..last (last - first + 1 entries) from a list such as "3,5;7": 1 for
 * each listed frame, 0 otherwise; "" gives all zeros. flags, when given, must hold that many
 * entries and is returned; otherwise a new array is returned, released with free(). Null on
 * failure (first > last or null text: code 32; a malformed list or a frame out of range:
 * code 7), leaving a given array as it was. */
PLANO_API uint32_t *abParseStringOfFrames(uint32_t first, uint32_t last, const char *text,
                                          uint32_t *flags);

/* Stabilising homographies out[0..n-1] from tracked ones in[0..n-1]. anchors (null: none)
 * flags the frames whose motion stays as tracked. ref_points (homogeneous, optional) and
 * ref_angles (radians, optional) are read at the anchor frames and overwritten for every
 * frame; residuals are decomposed about the point and along the angle. A nonzero flag
 * stabilises its component. iterations -1 flattens the chosen components between anchors
 * (all eight: out is the reference motion itself); k >= 0 smooths them k times with a
 * 1-2-1 filter and pulls frames outside the anchors towards them. out may be in. */
PLANO_API Plx_Bool bSmoothHomographies(const uint32_t *anchors, const Plx_Matrix33 *in,
                                       Plx_Vector3 *ref_points, double *ref_angles, uint32_t n,
                                       int32_t x_translation, int32_t y_translation,
                                       int32_t rotation, int32_t scale, int32_t shear,
                                       int32_t aspect, int32_t perspective_x,
                                       int32_t perspective_y, int32_t iterations,
                                       Plx_Matrix33 *out);

/* Components of H with shear and aspect measured along ref_angle. h22 = 0 or a degenerate
 * top-left block: code 18. */
PLANO_API Plx_Bool bDecomposeHomography(const Plx_Matrix33 *H, double ref_angle,
                                        HomographyComponents *components);
/* The exact inverse of bDecomposeHomography (h22 = 1). */
PLANO_API Plx_Bool bReconstructHomography(const HomographyComponents *components,
                                          double ref_angle, Plx_Matrix33 *H);
/* out = a..b at t for each component in mask (bits as PLANO_MASK_*): linear, rotation along
 * the shorter arc, scale geometrically; components outside mask are left as they are. */
PLANO_API Plx_Bool bInterpolateComponents(HomographyComponents *out, const HomographyComponents *a,
                                          const HomographyComponents *b, double t, uint32_t mask);

/* Principal square roots by Newton's iteration from the identity: code 20 after 1000 updates
 * without convergence, code 1 on a singular iterate. */
PLANO_API Plx_Bool bMatrix22SquareRoot(const Plx_Matrix22 *A, Plx_Matrix22 *root);
PLANO_API Plx_Bool bMatrix33SquareRoot(const Plx_Matrix33 *A, Plx_Matrix33 *root);
/* Symmetric positive semi-definite square root from the eigen-decomposition (lower triangle
 * read); a negative eigenvalue fails with code 32. */
PLANO_API Plx_Bool bSymMatrix22SquareRoot(const Plx_Matrix22 *A, Plx_Matrix22 *root);

/* Sets up powers of M with L = levels (at most 24: code 32): the chain of repeated square
 * roots is computed now, powers on demand. The record's previous arrays are not released. */
PLANO_API Plx_Bool bMatrix33GeneralRootInit(const Plx_Matrix33 *M, uint32_t levels,
                                            Matrix33GeneralRoot *root);
/* M^t for t >= 0, t rounded to a multiple of 1/2^L; t >= 1 squares the result for t/2.
 * A negative or non-finite t: code 32. */
PLANO_API Plx_Bool bMatrix33GeneralRoot(Matrix33GeneralRoot *root, double t, Plx_Matrix33 *out);
/* Releases the three arrays and leaves the record empty; null is ignored. */
PLANO_API void vMatrix33GeneralRootFree(Matrix33GeneralRoot *root);

/* A large axis-aligned rectangle of set pixels of region (a bit image): box = x, y, width,
 * height in the image's pixel coordinates, of roughly the image's aspect ratio before it is
 * grown edge by edge; (0, 0, 0, 0) for a region without set pixels. Every pixel of the box is
 * set. */
PLANO_API Plx_Bool bComputeInnerBox(const Plx_Image *region, uint32_t box[4]);

#ifdef __cplusplus
}
#endif

#endif
