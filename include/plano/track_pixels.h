/* Planar tracking: mask preparation and per-pixel preparation of the tracked images.
 *
 * Masks are bit images (one bit per pixel, rows of 32-bit words). The smoothing here is the
 * small masked 3-tap smoothing the homography optimiser applies to every pyramid level; the
 * pixel parameters choose a gradient threshold and a sampling so that enough, well-spread
 * textured pixels are used by the trackers that work on selected pixels only.
 *
 * Sampling patterns (a sampling value s): 0 and 1 every pixel; 2 the pixels with row + column
 * even; s >= 3 the pixels whose row and column are both multiples of floor(sqrt(s + 0.01)). */
#ifndef PLANO_TRACK_PIXELS_H
#define PLANO_TRACK_PIXELS_H

#include "pellux/image.h"
#include "plano/plano_base.h"
#include "plano/threads.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Shrinks mask layer by layer from its boundary inward, clearing boundary pixels where the
 * 8-bit RGB images a and b (mask's size) differ by less than threshold in every channel,
 * until a pass clears nothing. Returns a new bit image, or result reformed to the mask's
 * size. */
PLANO_API Plx_Image *pgiTrackBuildMask(const Plx_Image *image_a, const Plx_Image *image_b,
                                       const Plx_Image *mask, int32_t threshold,
                                       Plx_Image *result);

/* A height x width image of image's format and type, zero except where mask (image's size)
 * is set at (row0 + r, col0 + c), where it holds image's pixel there. Positions outside the
 * image or mask stay zero. */
PLANO_API Plx_Image *pgiTrackCombineMask(const Plx_Image *image, const Plx_Image *mask,
                                         int32_t row0, int32_t col0, uint32_t height,
                                         uint32_t width, Plx_Image *result);

/* A float copy of image in its own format (the passes take grey, RGB and BGR; other formats
 * fail with code 2 unless passes is 0) smoothed `passes` times with the masked 3-tap kernel (centre 1/3 and 1/6 for each of the
 * four neighbours where all are usable, else 2/3 and 1/6 along one axis, else unchanged),
 * each pass split into row stripes over the host's jobs. mask (image's size) or null: a pixel
 * is usable when its bit is set. result and second are reused when given (second is the
 * other image of the ping-pong; it must not be result). Returns result or a new image. */
PLANO_API Plx_Image *pgiSmoothImage(const Plx_Image *image, const Plx_Image *mask,
                                    uint32_t passes, Plx_Image *result, Plx_Image *second,
                                    const ThreadHostInterface *host);

/* One stripe of one smoothing pass. */
typedef struct TrackSmoothJob {
    const Plx_Image *source;  /* float or double, grey or RGB */
    Plx_Image *dest;          /* source's format, type and size; not source */
    const Plx_Image *mask;    /* bit image of source's size, or null */
    uint32_t first_row;
    uint32_t row_count;
} TrackSmoothJob;

/* Job function of pgiSmoothImage: smooths rows [first_row, first_row + row_count) of a
 * TrackSmoothJob. Other formats or types: code 2. */
PLANO_API Plx_Bool gbSmoothImage(void *job);

/* Chooses a gradient threshold and a sampling (see the top of this header) for the masked
 * pixels of image (grey, RGB or RGBA; 8-bit, 16-bit, 32-bit unsigned or float; else code 2).
 * The threshold is lowered from start_threshold by threshold_step until the selected pixels
 * (squared central-difference gradient at least the squared threshold, on the sampling
 * pattern) number more than min_fraction of the mask's pixels and their bounding box covers
 * more than area_fraction of the mask's active window; then the sampling is thinned while
 * both still hold. A threshold reaching 0 gives threshold 0 and the given sampling; an empty
 * mask gives 0 and 2. The gradient and selection buffers are reused when given (after the
 * call the selection holds the last one tried, not necessarily the reported one). */
PLANO_API Plx_Bool bTrackComputePixelParameters(
    const Plx_Image *image, const Plx_Image *mask, double start_threshold,
    double threshold_step, uint32_t sampling, double min_fraction, double area_fraction,
    double *threshold_out, uint32_t *sampling_out, Plx_Image *gradient_buffer,
    Plx_Image *selection_buffer, const ThreadHostInterface *host);

/* Clears selection (a bit image of gradient's size) and sets every pixel whose squared
 * gradient (grey or RGB gradient image of 32-bit unsigned, float or double; colour channels
 * summed) is at least squared_threshold and that lies on the sampling pattern, in row stripes
 * over the host's jobs. count receives the number of pixels set and bounds (may be null)
 * their bounding box. */
PLANO_API Plx_Bool bComputeSelectedPixel(const Plx_Image *gradient, double squared_threshold,
                                         uint32_t sampling, Plx_Image *selection,
                                         uint32_t *count, Plx_Window *bounds,
                                         const ThreadHostInterface *host);

#ifdef __cplusplus
}
#endif

#endif
