/* The tracker's joint homography optimiser.
 *
 * bTrackHomogOptimise refines the homographies of all regions of a Track together, coarse to
 * fine over the image pyramid. At each level bMatchImages builds one Sumo optimiser holding,
 * per region, a homography state with an illumination state (gain, offset) hanging below it,
 * block observations comparing reference pixels with the current image warped by the
 * homography, optional prior observations on the homography, and the constraint-point and
 * angle observations tying regions together; Levenberg-Marquardt iterations then refine them.
 * At the termination level it also leaves in each region its information matrix, an
 * observation mask, the RMS residual, the rejected-pixel fraction and the final status.
 *
 * Coordinates are pixels of the region windows at the current level; the homogeneous third
 * coordinate of every point is the camera's zh divided by 2^level, so one homography serves
 * every level. Pixel (c, r) of an image has its centre at (c + 0.5, r + 0.5). */
#ifndef PLANO_TRACK_HOMOGRAPHY_H
#define PLANO_TRACK_HOMOGRAPHY_H

#include "pellux/fixed.h"
#include "pellux/image.h"
#include "pellux/matrix.h"
#include "pellux/memory.h"
#include "plano/plano_base.h"
#include "plano/sumo.h"
#include "plano/threads.h"
#include "plano/track.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Sumo type codes of the homography states, one per motion model. */
#define TRACK_STATE_PROJ 4097
#define TRACK_STATE_AFFINE 4353
#define TRACK_STATE_TRANSLATE 4355
#define TRACK_STATE_TRANS_SCALE 4356
#define TRACK_STATE_TRANS_ROT_SCALE 4357

/* The user data of one pixel-match observation: the block's homogeneous coordinate, the
 * search pixel image (single-precision float, grey, RGB or RGBA) and its optional bit mask at
 * the level, and the positions (x, y pairs) of the block's used reference pixels, in the
 * order of the observation vector.
 *
 * The optional gradient images (both or neither; the search image's format, type and size)
 * give the image derivatives of the Jacobians: they are interpolated bilinearly at the warped
 * position like the values. The tracker fills them with bTrackSearchGradients at its
 * finest level; coarser levels keep the interpolant's derivatives for their pull-in. Without
 * them the derivatives are those of the bilinear interpolant itself, whose fixed point under
 * noise in the search image leans towards half-pixel positions. */
typedef struct TrackPixelBlock {
    double zh;
    float zh_f;
    const Plx_Image *search_image;
    const Plx_Image *search_mask;   /* null: every search pixel may be used */
    const float *positions;         /* 2 x no_pixels floats */
    uint32_t no_pixels;
    const Plx_Image *search_gradient_x;  /* null: derivatives of the interpolant */
    const Plx_Image *search_gradient_y;
} TrackPixelBlock;

/* User data of a constraint-point observation whose target is estimated: zh, and the origin
 * of the search window at the level. */
typedef struct TrackConstraintPointData {
    double zh;
    float zh_f;
    double search_origin[2];
} TrackConstraintPointData;

/* ---- the optimiser ---- */

/* Runs bMatchImages from the coarsest level down to the track's termination level; stops
 * early (success) when the host's interrupt query answers nonzero. host and status_time may
 * be null. */
PLANO_API Plx_Bool bTrackHomogOptimise(Track *track, int32_t iterations, double lambda,
                                       double lambda_factor, const ThreadHostInterface *host,
                                       StatusTime *status_time);
/* One pyramid level of the joint optimisation (statistics at the termination level). */
PLANO_API Plx_Bool bMatchImages(Track *track, int32_t iterations, double lambda,
                                double lambda_factor, uint32_t level,
                                const ThreadHostInterface *host, StatusTime *status_time);

/* ---- states ---- */

/* Initialises state (made with room for 9 parameters) as the model's homography state from
 * H. Code 7 when H lacks the model's shape, code 12 for an unknown model. */
PLANO_API Plx_Bool bMotionInit(Sumo *sumo, SumoStateVector *state, uint32_t model,
                               const Plx_Matrix33 *homography);
/* The 3x3 matrix of a homography state of any of the five types (code 1 for another). */
PLANO_API Plx_Bool bPixelMatchMatRead(const SumoStateVector *state, Plx_Matrix33 *homography);
/* The illumination state (gain, offset) in a new branch hanging from the homography state. */
PLANO_API Plx_Bool bIllumInit(Sumo *sumo, SumoStateVector *homography_state, double gain,
                              double offset, Plx_MemoryStack *ms, const ThreadHostInterface *host,
                              SumoStateVector **illumination_state);

/* ---- homography observations ---- */

/* An observation that the homography state equals H with the given information (sized by
 * the model). *obs (may be null) receives it. */
PLANO_API Plx_Bool bHomogObs(Sumo *sumo, SumoStateVector *state, uint32_t model,
                             const Plx_Matrix33 *homography, const Plx_SquMatrix *information,
                             Plx_MemoryStack *ms, SumoObs **obs);
/* The motion prior of scale w holding the state near H, for a template of height x width
 * pixels at homogeneous coordinate zh. Code 18 when w, height or width is 0 (or projective
 * H22 is 0). */
PLANO_API Plx_Bool bAddHomogObs(Sumo *sumo, SumoStateVector *state, uint32_t model,
                                const Plx_Matrix33 *homography, double w, uint32_t height,
                                uint32_t width, double zh, Plx_MemoryStack *ms);
/* The h functions of bHomogObs: the state's parameters (projective: their difference from
 * the nine numbers in z's user data), Jacobian the identity. */
PLANO_API Plx_Bool bAffineHomogH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                 uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                                 Plx_Matrix **jacobians);
PLANO_API Plx_Bool bProjHomogH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                               uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                               Plx_Matrix **jacobians);
PLANO_API Plx_Bool bTranslateHomogH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                    uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                                    Plx_Matrix **jacobians);
PLANO_API Plx_Bool bTransRotScaleHomogH(Sumo *sumo, SumoWorkspace *workspace,
                                        SumoStateVector **states, uint32_t n_states,
                                        const SumoVector *z, Plx_Vector *h,
                                        Plx_Matrix **jacobians);
PLANO_API Plx_Bool bTransScaleHomogH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                     uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                                     Plx_Matrix **jacobians);

/* ---- pixel-match observations ----
 * States: (homography, illumination or null). z holds the reference values of the block's
 * pixels (R, G, B per pixel for the RGB functions); z's user data is a TrackPixelBlock. A
 * pixel whose bilinear footprint leaves the search image or its mask predicts its own
 * observed value with zero derivatives. The image derivatives come from the block's gradient
 * images when it has them, else from the interpolant. Arithmetic is single precision. */
PLANO_API Plx_Bool bPixelMatchAffineH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                      uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                                      Plx_Matrix **jacobians);
PLANO_API Plx_Bool bPixelMatchProjH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                    uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                                    Plx_Matrix **jacobians);
PLANO_API Plx_Bool bPixelMatchTranslateH(Sumo *sumo, SumoWorkspace *workspace,
                                         SumoStateVector **states, uint32_t n_states,
                                         const SumoVector *z, Plx_Vector *h,
                                         Plx_Matrix **jacobians);
PLANO_API Plx_Bool bPixelMatchTransRotScaleH(Sumo *sumo, SumoWorkspace *workspace,
                                             SumoStateVector **states, uint32_t n_states,
                                             const SumoVector *z, Plx_Vector *h,
                                             Plx_Matrix **jacobians);
PLANO_API Plx_Bool bPixelMatchTransScaleH(Sumo *sumo, SumoWorkspace *workspace,
                                          SumoStateVector **states, uint32_t n_states,
                                          const SumoVector *z, Plx_Vector *h,
                                          Plx_Matrix **jacobians);
PLANO_API Plx_Bool bPixelMatchAffineRGBH(Sumo *sumo, SumoWorkspace *workspace,
                                         SumoStateVector **states, uint32_t n_states,
                                         const SumoVector *z, Plx_Vector *h,
                                         Plx_Matrix **jacobians);
PLANO_API Plx_Bool bPixelMatchProjRGBH(Sumo *sumo, SumoWorkspace *workspace,
                                       SumoStateVector **states, uint32_t n_states,
                                       const SumoVector *z, Plx_Vector *h,
                                       Plx_Matrix **jacobians);
PLANO_API Plx_Bool bPixelMatchTranslateRGBH(Sumo *sumo, SumoWorkspace *workspace,
                                            SumoStateVector **states, uint32_t n_states,
                                            const SumoVector *z, Plx_Vector *h,
                                            Plx_Matrix **jacobians);

/* The image derivatives of a search pixel image (float, grey, RGB or RGBA) into the image
 * records gx and gy, which are (re)formed with the image's format, type and size. Per channel
 * and pixel: half the difference of the two neighbours along the axis when both are in the
 * image and the mask (null: all set), the one-sided difference when only one is, else 0.
 * Returns 1, or 0 with code 32 for an unsupported image, 7 for a mask that does not fit. */
PLANO_API Plx_Bool bTrackSearchGradients(const Plx_Image *image, const Plx_Image *mask, Plx_Image *gx,
                                         Plx_Image *gy);

/* One region's block observations at a level. */
typedef struct TrackPixelObsJob {
    Sumo *sumo;
    Plx_MemoryStack *ms;
    SumoStateVector *homography_state;
    SumoStateVector *illumination_state;  /* may be null */
    uint32_t model;
    const Plx_Image *reference;           /* float pixel image of the reference window */
    const Plx_Image *reference_mask;      /* may be null */
    const Plx_Image *search;              /* float pixel image of the search window */
    const Plx_Image *search_mask;         /* may be null */
    const Plx_Image *search_gradient_x;   /* may be null (both or neither): see TrackPixelBlock */
    const Plx_Image *search_gradient_y;
    double zh;                            /* homogeneous coordinate at the level */
    uint32_t block_size;                  /* at least 1 */
    uint32_t sampling;                    /* already shifted by the level */
    double texture_threshold;             /* 0: no texture test */
    double intensity_sigma;
    double robust_scale;                  /* 0: plain observations */
    double outlier_cutoff;                /* per used pixel */
    /* Results, taken from ms. */
    uint32_t blocks_across, blocks_down;
    uint32_t no_obs;
    SumoObs **obs;                        /* no_obs entries */
    TrackPixelBlock *blocks;              /* no_obs entries */
} TrackPixelObsJob;

/* Builds the job's observations, their arrays taken from ms (run by one host worker while
 * the caller waits, when host is given). */
PLANO_API Plx_Bool bBuildPixelObservations(TrackPixelObsJob *job, const ThreadHostInterface *host);
/* The worker entry of bBuildPixelObservations (argument: the TrackPixelObsJob). */
PLANO_API Plx_Bool gbBuildPixelObservations(void *job);

/* ---- constraint points and angles ---- */

/* The observations of one constraint point at the level (its regions' states must be set).
 * A point whose target is not given gets a target state (stored in the point). */
PLANO_API Plx_Bool bBuildConstraintPointObservations(Sumo *sumo, Track *track,
                                                     TrackConstraintPoint *point, uint32_t level,
                                                     Plx_MemoryStack *ms,
                                                     const ThreadHostInterface *host);
/* F = H(reference) - target, z = (reference, target), user data: a double zh. */
PLANO_API Plx_Bool bConstraintPointTwoImagesF(Sumo *sumo, SumoWorkspace *workspace,
                                              SumoStateVector **states, uint32_t n_states,
                                              const SumoVector *z, Plx_Vector *F,
                                              Plx_Matrix **jacobians, Plx_Matrix *Fz);
/* F = H(reference) + search origin - target state, z = reference, states (homography,
 * target), user data a TrackConstraintPointData. */
PLANO_API Plx_Bool bConstraintPointOneImageF(Sumo *sumo, SumoWorkspace *workspace,
                                             SumoStateVector **states, uint32_t n_states,
                                             const SumoVector *z, Plx_Vector *F,
                                             Plx_Matrix **jacobians, Plx_Matrix *Fz);
/* Sets the point's target state to the mean of its reference point mapped by each region's
 * homography (plus that region's search origin / 2^level). Code 18 on a zero third
 * coordinate. */
PLANO_API Plx_Bool bConstraintPointInit(Sumo *sumo, TrackConstraintPoint *point, uint32_t level);
/* The signed angle at P from A to B, atan2(u_y v_x - u_x v_y, u . v) with u = A - P,
 * v = B - P, and (when derivatives is not null) its derivatives with respect to P, A and B
 * (six numbers). Undefined when |u|^2 or |v|^2 is at most threshold: code 18 registered, or
 * with error_code given 29 written there and nothing registered. */
PLANO_API Plx_Bool bCalcConstraintAngle(const double P[2], const double A[2], const double B[2],
                                        double threshold, double *angle, double derivatives[6],
                                        int32_t *error_code);
/* The angle observation over the three target states; z's user data points at the squared
 * position threshold (a double). The prediction is taken within pi of z. */
PLANO_API Plx_Bool bAngleConstraintH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                     uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                                     Plx_Matrix **jacobians);

#ifdef __cplusplus
}
#endif

#endif
