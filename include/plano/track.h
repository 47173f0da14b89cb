/* Planar tracking: the tracker object, its regions and constraints, and the per-frame driver.
 *
 * One Track covers one pair of frames: the previous image (where each region's mask says
 * where the region is now) and the current image (where it is searched for), each with its
 * camera. Regions are masked patches of a reference image (which may be the previous image)
 * with a motion model, a starting homography and their settings; constraint points and angle
 * constraints may tie regions together. bTrackOptimise runs a coarse correlation search per
 * region and then one joint homography optimisation of all regions, coarse to fine over an
 * image pyramid, and leaves in each region its homography, information matrix, intensity
 * model and status.
 *
 * At the interface a region's homography maps reference-image coordinates to current-image
 * coordinates in the calibrated units of the cameras; inside the tracker it works in pixel
 * coordinates of the windows cut from the images. The caller owns every image it passes in;
 * the Track never frees them. */
#ifndef PLANO_TRACK_H
#define PLANO_TRACK_H

#include "pellux/camera.h"
#include "pellux/fixed.h"
#include "pellux/image.h"
#include "pellux/list.h"
#include "pellux/matrix.h"
#include "plano/plano_base.h"
#include "plano/sumo.h"
#include "plano/threads.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Motion models (TrackMotionModel, u32), with their parameter counts. */
#define TRACK_MODEL_AFFINE 0u          /* 6: last row 0 0 1 */
#define TRACK_MODEL_PROJ 1u            /* 9 (8 degrees of freedom): full 3x3 */
#define TRACK_MODEL_TRANSLATE 2u       /* 2: identity plus translation */
#define TRACK_MODEL_TRANS_ROT_SCALE 3u /* 4: [a -b tx; b a ty; 0 0 1] */
#define TRACK_MODEL_TRANS_SCALE 4u     /* 3: [s 0 tx; 0 s ty; 0 0 1] */
typedef uint32_t TrackMotionModel;

/* Region statuses (TrackRegionStatus, u32). 3 is not used. */
#define TRACK_REGION_OK 0u
#define TRACK_REGION_LOST 1u          /* internal failure, no sweep peak, too many rejected */
#define TRACK_REGION_NO_MATCH 2u      /* correlation failed or found no acceptable peak */
#define TRACK_REGION_PYRAMID_FAILED 4u
#define TRACK_REGION_TOO_FEW_PIXELS 5u
#define TRACK_REGION_OUT_OF_VIEW 6u
typedef uint32_t TrackRegionStatus;

/* Correlation size that turns the coarse search off (visibility test only). */
#define TRACK_NO_CORRELATION 0xFFFFFFFFu
/* Most constraint points one region takes part in. */
#define TRACK_MAX_REGION_CONSTRAINT_POINTS 4u

/* Progress bookkeeping: estimated total work and the work done so far (arbitrary units). */
typedef struct StatusTime {
    double total;
    double done;
} StatusTime;

typedef struct Track Track;
typedef struct TrackRegion TrackRegion;
typedef struct TrackConstraintPoint TrackConstraintPoint;
typedef struct TrackAngleConstraint TrackAngleConstraint;

struct Track {
    Plx_Image *previous_image;       /* borrowed */
    Plx_Image *current_image;        /* borrowed */
    Plx_Camera previous_camera;
    Plx_Camera current_camera;
    uint32_t levels;                 /* pyramid levels of every region */
    uint32_t termination_level;      /* finest level the optimiser visits (0 = full size) */
    uint32_t extract_active_channel; /* 1: colour regions tracked on their most varied channel */
    double angle_pos_threshold_sq;   /* squared, handed to every angle observation */
    Plx_List *regions;               /* TrackRegion, newest first */
    Plx_List *constraint_points;     /* TrackConstraintPoint, newest first */
    Plx_List *angle_constraints;     /* TrackAngleConstraint, newest first */
    double status_start;             /* progress fraction used when bTrackOptimise starts */
    double status_range;             /* progress fraction one bTrackOptimise call may use */
    double display_zoom;             /* kept for the caller; no tracking step reads it */
    Plx_Image *distance_scratch;     /* borrowed, may be null: 16-bit grey distance maps */
};

/* The settings of pTrackRegion, stored as given. */
typedef struct TrackRegionSettings {
    double smoothing_sigma;          /* Gaussian pre-smoothing of the windows; 0 = none */
    uint32_t correlation_size;       /* template size of the coarse search; TRACK_NO_CORRELATION */
    double rotation_range;           /* half-range of the rotation sweep, radians, [0, pi] */
    double scale_range;              /* half-range of the scale sweep (0.1 = +-10 %) */
    double rotation_step;            /* arc length in pixels between rotation samples */
    uint32_t search_range_y;         /* pixels above and below the region */
    uint32_t search_range_x;         /* pixels left and right of the region */
    uint32_t motion_model;           /* TrackMotionModel */
    double min_overlap;              /* least visible fraction of template pixels */
    double texture_threshold;        /* > 0: only textured template pixels correlate */
    double min_corr_score;           /* a peak below it is never accepted */
    uint32_t min_pixel_count;        /* this many used pixels or fewer: status 5 */
    double peak_sharpness;           /* 0 = off; least drop from the peak to its neighbours */
    uint32_t smoothing_passes;       /* masked 3-tap passes of the pixel images per level */
    double max_rejected_fraction;    /* 0 = off; above it: status 1 */
    uint32_t pixel_sampling;         /* >> level; 0, 1 all, 2 checkerboard, s >= 3 grid */
    double motion_prior_scale;       /* 0 = off */
    uint32_t block_size;             /* pixels per side of one pixel-match block, >> level */
    double intensity_sigma;          /* pixel noise; observation information 1/sigma^2 */
    double robust_scale;             /* 0 = plain block observations */
    double outlier_cutoff;           /* chi-squared cutoff per used pixel of a robust block */
} TrackRegionSettings;

struct TrackRegion {
    Plx_Camera camera;               /* copy of the reference camera */
    /* The three pyramids. reference points at template when the reference image is the
     * previous image; template points at search when previous and current are one image. */
    Plx_ImagePyramid *reference_pyramid;
    Plx_ImagePyramid *template_pyramid;
    Plx_ImagePyramid *search_pyramid;
    /* Window geometry: origin of the reference window in the reference image, of the region
     * window in the previous image, of the search window in the current image. */
    double template_origin[2];
    double region_origin[2];
    double search_origin[2];
    uint32_t template_position[2];   /* the template's position in the reference image */
    TrackRegionSettings settings;
    Plx_Matrix33 homography;
    Plx_Vector homography_vector;    /* views the nine numbers of homography */
    Plx_SquMatrix *information;      /* symmetric, sized by the motion model */
    uint32_t information_given;
    double gain, offset;             /* intensity model */
    uint32_t levels;
    Plx_Image *observation_mask;     /* binary, termination level; null until made */
    TrackRegionStatus status;
    double corr_offset[2];           /* x, y in full-resolution pixels */
    double corr_score;
    double rms_residual;
    double rejected_fraction;
    SumoStateVector *state;          /* homography state while an optimisation runs */
    TrackConstraintPoint *constraint_points[TRACK_MAX_REGION_CONSTRAINT_POINTS];
    uint32_t no_constraint_points;
    uint32_t boundary_distance_weighting; /* default 1 */
    /* Buffers handed to pTrackRegion (borrowed, may be null). */
    Plx_Image *correlation_buffer;
    Plx_Image *template_buffer;
    /* Images and pyramid records the region made, released by vTrackFree (null slots are
     * unused; caller buffers and pyramid storage never appear here). */
    Plx_Image *owned_images[10];
    Plx_ImagePyramid *owned_pyramids[3];
    /* Channel the windows were cut from: 0 every channel, else 1 red, 2 green, 3 blue. */
    uint32_t active_channel;
    /* 1 while homography and information are in window pixels (from pTrackRegion until
     * bTrackOptimise hands them back in calibrated coordinates). */
    uint32_t in_window_pixels;
};

struct TrackConstraintPoint {
    TrackRegion **regions;           /* own allocation */
    uint32_t no_regions;
    double reference_point[2];       /* reference-image coordinates */
    double reference_information[3];/* xx, xy, yy */
    uint32_t target_known;
    double target_point[2];          /* given, or written by the optimiser */
    double target_information[3];    /* given, or written by the optimiser */
    SumoStateVector *target_state;   /* while an optimisation runs */
};

struct TrackAngleConstraint {
    TrackConstraintPoint *points[3];
    double angle;                    /* radians */
    double information;              /* 1 / sigma^2 */
};

/* ---- creation and settings ---- */

/* New track over two borrowed frames; the cameras are copied. levels >= 1. Code 32 when the
 * cameras' zh differ. distance_scratch (16-bit grey, may be null) is reused for distance maps. */
PLANO_API Track *pTrackNew(Plx_Image *previous_image, const Plx_Camera *previous_camera,
                           Plx_Image *current_image, const Plx_Camera *current_camera,
                           uint32_t levels, Plx_Image *distance_scratch);
PLANO_API void vTrackSetExtractActiveChannel(Track *track, uint32_t flag);
/* A level at or above the number of levels stores levels - 1. */
PLANO_API void vTrackSetTerminationLevel(Track *track, uint32_t level);
/* Stores the threshold squared. */
PLANO_API void vTrackSetAngleConstraintPosThreshold(Track *track, double threshold);
/* Progress fractions (0..1) of the caller's bar that bTrackOptimise uses. */
PLANO_API void vTrackSetStatusTimeLimits(Track *track, double start, double end);
PLANO_API void vTrackSetDisplayZoom(Track *track, double zoom);
PLANO_API void vTrackRegionSetBoundaryDistanceWeighting(TrackRegion *region, uint32_t flag);

/* Adds a region at the head of the track's list. Images are borrowed; the camera, homography
 * (reference -> previous frame, calibrated), information (may be null) and intensity model
 * (gain, offset; null gives 1, 0) are copied. Buffers and pyramid records may be null; given
 * ones are reused and never freed. Code 32 for a negative smoothing sigma, a rotation range
 * outside [0, pi], a negative scale range, a rotation sweep without a positive step or an
 * intensity sigma that is not positive; 12 an unknown model; 7 information of another size;
 * 24 an empty region mask; 23 a search window wholly outside the current image. When the
 * previous and current images are one image, the region's own window is also its search
 * window. Returns null with the track unchanged on failure. */
PLANO_API TrackRegion *pTrackRegion(
    Track *track, Plx_Image *previous_mask, Plx_Image *reference_image,
    const Plx_Camera *reference_camera, Plx_Image *reference_mask, Plx_Image *current_valid_mask,
    const Plx_Matrix33 *homography, const Plx_SquMatrix *information,
    const double *intensity_model, double smoothing_sigma, uint32_t correlation_size,
    double rotation_range, double scale_range, double rotation_step, uint32_t search_range_y,
    uint32_t search_range_x, uint32_t motion_model, double min_overlap, double texture_threshold,
    double min_corr_score, uint32_t min_pixel_count, double peak_sharpness,
    uint32_t smoothing_passes, double max_rejected_fraction, uint32_t pixel_sampling,
    double motion_prior_scale, uint32_t block_size, double intensity_sigma, double robust_scale,
    double outlier_cutoff, Plx_Image *correlation_buffer, Plx_Image *template_buffer,
    Plx_Image *window_buffer, Plx_Image *smoothed_window_buffer,
    Plx_Image *smoothed_template_buffer, Plx_Image *smoothing_scratch,
    Plx_ImagePyramid *search_pyramid_storage, Plx_ImagePyramid *template_pyramid_storage,
    Plx_ImagePyramid *reference_pyramid_storage, const ThreadHostInterface *host);

/* Constraint points: reference_information and target_information are (xx, xy, yy). A null
 * target point means the optimiser estimates it. Code 7 when a region already has 4 points,
 * is listed twice or is not one of the track's regions; nothing is added then. */
PLANO_API TrackConstraintPoint *pTrackConstraintPoint1Region(
    Track *track, TrackRegion *region, const double reference_point[2],
    const double reference_information[3], const double target_point[2],
    const double target_information[3]);
PLANO_API TrackConstraintPoint *pTrackConstraintPoint2Regions(
    Track *track, TrackRegion *region_a, TrackRegion *region_b, const double reference_point[2],
    const double reference_information[3], const double *target_point,
    const double target_information[3]);
PLANO_API TrackConstraintPoint *pTrackConstraintPointNRegions(
    Track *track, TrackRegion **regions, uint32_t no_regions, const double reference_point[2],
    const double reference_information[3], const double *target_point,
    const double target_information[3]);
/* The angle at a between b and c is held at angle (radians) with information 1/sigma^2;
 * sigma 0 fails with code 18. */
PLANO_API Plx_Bool bAngleConstraint(Track *track, TrackConstraintPoint *a, TrackConstraintPoint *b,
                                    TrackConstraintPoint *c, double angle, double sigma);

/* ---- models, estimates, progress ---- */

/* The more general of two models (projective > affine > trans-rot-scale > trans-scale >
 * translation); 0xFFFFFFFF with code 12 when either is not a model. */
PLANO_API uint32_t eMostGeneralTrackingModel(uint32_t model_a, uint32_t model_b);
/* Work estimates in arbitrary units, shared by the progress reports. */
PLANO_API double dTrackEstimateCorrTime(const Track *track);
PLANO_API double dTrackEstimateHomogTime(uint32_t level);
/* Adds increment to the done part; calls progress(context, percentage 0..99) when given. */
PLANO_API void vStatusTimeIncrement(StatusTime *status_time, double increment,
                                    ThreadProgressFunction progress, void *context);
/* New 9x9 information matrix (positive semi-definite) of a projective homography with no
 * information along H itself. Code 18 for a zero H. */
PLANO_API Plx_SquMatrix *pgsymmatComputeInformationMatrix(const Plx_Matrix33 *homography);

/* ---- homography conversions ---- */

/* Brings H to its model's shape (dividing by H22, code 18 when 0); *scale (may be null)
 * receives H22. A projective H is left as it is, any H22 included, with scale 1. */
PLANO_API Plx_Bool bCorrectHomography(uint32_t model, Plx_Matrix33 *homography, double *scale);
/* direction 0: pixels -> calibrated, H = K_A^-1 H K_B; direction 1: calibrated -> pixels,
 * H = K_A H K_B^-1 (K_B the region camera's matrix; each K divided by its zh), after which
 * the reduced models take the nearest member of their family. The information matrix, when
 * given (of the model's size, code 7), becomes J^T I J with J = d(old parameters) / d(new
 * parameters); parameters: affine (H00 H01 H02 H10 H11 H12), projective the nine entries,
 * translation (H02 H12), trans-rot-scale (a tx b ty), trans-scale (s tx ty). */
PLANO_API Plx_Bool bTrackApplyCalibToHomography(Plx_Matrix33 *homography,
                                                Plx_SquMatrix *information, uint32_t model,
                                                const Plx_Camera *camera_a,
                                                const TrackRegion *region, uint32_t direction);
/* H = T(offset_a / zh_a) H T(-offset_b / zh_b), signs reversed when inverse is nonzero; the
 * information as above. Code 18 when a zh is 0. */
PLANO_API Plx_Bool bTrackApplyOffsetsToHomography(Plx_Matrix33 *homography,
                                                  Plx_SquMatrix *information, uint32_t model,
                                                  const double offset_a[2], double zh_a,
                                                  const double offset_b[2], double zh_b,
                                                  uint32_t inverse);
/* The channel (1 red, 2 green, 3 blue) of greatest variance over the masked pixels of the
 * window (height x width at row0, col0) of an RGB or RGBA image; green without pixels. */
PLANO_API Plx_Bool bComputeActiveChannel(const Plx_Image *image, const Plx_Image *mask,
                                         int32_t row0, int32_t col0, uint32_t height,
                                         uint32_t width, uint32_t *channel);

/* Cuts a region out of image: the bounding box of mask's set pixels (mask null: the whole
 * image; a mask without set pixels fails with code 24), grown through a non-linear camera to
 * cover the undistorted region and made odd-sized where the image allows. window receives the
 * box's pixels (resampled into the camera's linear version when the camera has distortion;
 * frame offset = the box's frame position) and window_mask the box's mask bits (all set
 * without a mask). With extract_active_channel set and a colour image, only one channel is
 * cut, as a grey image: *channel on entry (1 red, 2 green, 3 blue; 0 = choose it with
 * bComputeActiveChannel); *channel receives the channel used (0 = all). box receives the box
 * in the image's pixel coordinates. window and window_mask are zeroed records or images to
 * re-form; camera null means a linear camera. */
PLANO_API Plx_Bool bExtractRegion(const Plx_Image *image, const Plx_Image *mask,
                                  const Plx_Camera *camera, uint32_t extract_active_channel,
                                  uint32_t *channel, Plx_Image *window, Plx_Image *window_mask,
                                  Plx_Window *box);

/* ---- reading and freeing ---- */

/* Copies the region's homography (reference -> current image, calibrated); always 1. */
PLANO_API Plx_Bool bTrackMotionRead(const TrackRegion *region, Plx_Matrix33 *homography);
/* The region's information matrix (owned by the region). */
PLANO_API Plx_SquMatrix *psmTrackInfmatRead(const TrackRegion *region);
/* Gain then offset; always 1. */
PLANO_API Plx_Bool bTrackIntensityModelRead(const TrackRegion *region, double intensity[2]);
/* Frees the track, its regions and constraints; never the caller's images or buffers. */
PLANO_API void vTrackFree(Track *track);

/* ---- the per-frame driver ---- */

/* Tracks every region from the previous frame to the current one: coarse search, then the
 * joint homography optimisation, then back to calibrated coordinates. host may be null; an
 * interrupt through it returns 1 with the regions as far as they got. Whatever the outcome,
 * the regions' homographies and information matrices are left in calibrated coordinates;
 * a projective homography comes back with unit Frobenius norm. */
PLANO_API Plx_Bool bTrackOptimise(Track *track, int32_t iterations, double lambda,
                                  double lambda_factor, const ThreadHostInterface *host);

#ifdef __cplusplus
}
#endif

#endif
