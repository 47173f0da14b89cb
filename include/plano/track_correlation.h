/* Planar tracking: the coarse correlation search.
 *
 * Before the homography optimiser refines a region, the region's template is correlated
 * exhaustively against the current image's search window at a coarse pyramid level (and
 * optionally over a sweep of rotations and scales) and the best peak moves the region's
 * homography by a whole-pixel translation.
 *
 * Correlation image of a template h_t x w_t over a search image h_s x w_s: (h_s - h_t + 1) x
 * (w_s - w_t + 1) pixels; pixel (dy, dx) scores the template with its top-left corner at
 * (dy, dx). Without a search mask it is grey (the normalised score C / (|T| |S|)); with one it
 * is a 2D vector field (score over the overlapping pixels, then the overlap as a fraction of
 * the template's weight). It is float for 8-bit, 16-bit and float templates and double for
 * int, unsigned int and double ones. Template weights: none (all 1), a bit mask, or a 16-bit
 * grey weight image (0 excludes a pixel). Colour templates (RGB, RGBA) sum over their three
 * colour channels; alpha is not used. */
#ifndef PLANO_TRACK_CORRELATION_H
#define PLANO_TRACK_CORRELATION_H

#include "pellux/image.h"
#include "plano/plano_base.h"
#include "plano/threads.h"
#include "plano/track.h"

#ifdef __cplusplus
extern "C" {
#endif

/* The correlation image of template over search (see the top of this header), its rows split
 * into stripes over the host's jobs (host may be null). texture_threshold > 0 keeps only the
 * template pixels off its border whose squared central-difference gradient reaches the
 * threshold (a fraction of full scale). result is reused when given. status_time (may be
 * null) advances by time_share in all. An interrupt (slot 2) ends the stripes early, with the
 * rows done so far. Template format not grey, RGB or RGBA: code 39; type not 8-bit, 16-bit,
 * int, unsigned int, float or double: code 38; search image of another format or type, or
 * smaller than the template, weight or mask of the wrong size: code 7. */
PLANO_API Plx_Image *pgiTrackImageCorrelate2D_q(const ThreadHostInterface *host,
                                                const Plx_Image *template_image,
                                                const Plx_Image *template_weight,
                                                const Plx_Image *search_image,
                                                const Plx_Image *search_mask,
                                                double texture_threshold, Plx_Image *result,
                                                StatusTime *status_time, double time_share);

/* One stripe of a correlation: output rows [first_row, first_row + row_count). */
typedef struct CorrelationJob {
    const ThreadHostInterface *host;   /* progress and interrupt; may be null */
    const Plx_Image *template_image;
    const Plx_Image *template_weight;  /* null, bit image or 16-bit grey, template's size */
    const Plx_Image *search_image;     /* template's format and type */
    const Plx_Image *search_mask;      /* null or bit image of search's size */
    Plx_Image *output;                 /* formed as described at the top of this header */
    uint32_t first_row;
    uint32_t row_count;
    StatusTime *status_time;           /* may be null */
    double time_share;                 /* the whole call's share; each stripe reports its rows' part */
    void *progress_guard;              /* private: serialises the stripes' progress reports */
} CorrelationJob;

/* The per-format workers: each computes the stripe of a CorrelationJob whose template is of
 * its format (gl grey, rgb, rgba) and type (i int, uc 8-bit, us 16-bit, ui unsigned int, f
 * float, d double). An output of the wrong format, type or size: code 7. Returns the output,
 * or null on failure. */
#define PLANO_CORRELATION_WORKER(suffix)                                                     \
    PLANO_API Plx_Image *pgiImageCorrelate2D_##suffix(const CorrelationJob *job);
PLANO_CORRELATION_WORKER(gl_i)
PLANO_CORRELATION_WORKER(gl_uc)
PLANO_CORRELATION_WORKER(gl_us)
PLANO_CORRELATION_WORKER(gl_ui)
PLANO_CORRELATION_WORKER(gl_f)
PLANO_CORRELATION_WORKER(gl_d)
PLANO_CORRELATION_WORKER(rgb_i)
PLANO_CORRELATION_WORKER(rgb_uc)
PLANO_CORRELATION_WORKER(rgb_us)
PLANO_CORRELATION_WORKER(rgb_ui)
PLANO_CORRELATION_WORKER(rgb_f)
PLANO_CORRELATION_WORKER(rgb_d)
PLANO_CORRELATION_WORKER(rgba_i)
PLANO_CORRELATION_WORKER(rgba_uc)
PLANO_CORRELATION_WORKER(rgba_us)
PLANO_CORRELATION_WORKER(rgba_ui)
PLANO_CORRELATION_WORKER(rgba_f)
PLANO_CORRELATION_WORKER(rgba_d)
#undef PLANO_CORRELATION_WORKER

/* Job function of the correlation: runs the worker of the job's template format and type. */
PLANO_API Plx_Bool gbApplyCorrelationToWindow(void *job);

/* The best peak of a correlation image (grey, or 2D vector field with the overlap; float or
 * double): scanning rows and columns from the last to the first, a score strictly above
 * *best, at least min_score and (with an overlap) of overlap at least min_overlap replaces
 * it, so equal scores go to the larger row, then column. With sharpness > 0 the peak must be
 * off the border and drop by at least sharpness to its neighbours, else *best is left as it
 * was. row and col are written whenever a peak was found. Format: code 39; type: code 38. */
PLANO_API Plx_Bool bGetBestCorrScore(const Plx_Image *correlation, double min_overlap,
                                     double min_score, double sharpness, int32_t *row,
                                     int32_t *col, double *best);

/* The 2-3 chamfer distance of every set pixel of mask (a bit image) to the nearest clear
 * pixel or to the outside of the image (2 per horizontal or vertical step, 3 per diagonal
 * step, saturating at 65534), 0 at clear pixels, into distance (reformed to 16-bit grey of
 * the mask's size and frame offset). */
PLANO_API Plx_Bool bImageChamferMap(const Plx_Image *mask, Plx_Image *distance);

/* The coarse search of one region (called by bTrackOptimise): a visibility test only when
 * its correlation size is TRACK_NO_CORRELATION; otherwise a correlation at the level chosen
 * from the correlation size, over the rotation and scale sweep when the region has one. The
 * region's homography, correlation offsets, score and status are updated; a region with no
 * acceptable peak keeps its homography (status 2, or 1 after a sweep). status_time (may be
 * null) advances by time_share; few_regions nonzero lets the visibility test report progress
 * too. host may be null; its slot 6, when set, replaces pgiTrackImageCorrelate2D_q. */
PLANO_API Plx_Bool bTrackRegionOptimise(Track *track, TrackRegion *region,
                                        StatusTime *status_time, double time_share,
                                        uint32_t few_regions, const ThreadHostInterface *host);

#ifdef __cplusplus
}
#endif

#endif
