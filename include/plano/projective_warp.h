/* The projective image warp between cameras.
 *
 * Every output pixel is pulled from the source image through a 3x3 homography placed between
 * two cameras: output pixel (X, Y) of camera A has its centre (X + 0.5, Y + 0.5), plus an
 * optional displacement vector, back-projected through camera A, mapped by the homography
 * and projected through camera B, which gives a position in the source's frame. Positions are
 * in frame coordinates: an image's pixel (c, r) sits at (c + image->x, r + image->y), so
 * windows cut from larger frames warp in place. A null camera is the identity camera
 * (unit focal lengths, centre 0, homogeneous scale 1); a null homography is the identity.
 *
 * Pixels are handled in single precision between reading and writing. The default path
 * blends the 2x2 neighbourhood of each position bilinearly and leaves pixels whose
 * neighbourhood is not wholly inside the source (and its mask) to the border rules; the
 * high-quality path treats outside neighbours as zero pixels, so edges fade out over one
 * pixel, and adds motion blur and alpha handling; the fast render replaces the per-pixel
 * projective division by one affine map per half-tile.
 *
 * Output validity mask: it starts as a copy of the output mask (all set when there is none or
 * it is ignored: formed to the output's size and frame offset when it has no pixels yet);
 * then every pixel of the requested output region (the output mask's active subwindow or the
 * background's extent, within the output window and the output image) that receives no
 * bilinear sample has its bit cleared. Bits outside that region are left alone. */
#ifndef PLANO_PROJECTIVE_WARP_H
#define PLANO_PROJECTIVE_WARP_H

#include "pellux/camera.h"
#include "pellux/fixed.h"
#include "pellux/image.h"
#include "plano/plano_base.h"
#include "plano/threads.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Colour correction applied to every written pixel, in single precision, alpha untouched:
 *   mode 0: c -> g c + o on every colour (or grey) channel; coefficients g, o
 *   mode 1: (c0, c1, c2) in stored channel order -> m (c0, c1, c2) + t; coefficients m
 *           (3x3, row-major) then t0, t1, t2; grey pixels are left as they are
 *   mode 2: each colour channel times the gain of its name (red, green, blue: blue-first
 *           layouts take the red gain on their last channel); grey times the fourth value
 * Any other mode fails with code 12. */
typedef struct WarpColourCorrection {
    int32_t mode;
    double coefficients[12];
} WarpColourCorrection;

/* Warp settings; all zeros (vInitProjectiveWarpParams) is the default: the whole output,
 * the bilinear path, no extras. */
typedef struct ProjectiveWarpParams {
    /* 2D vector field (int, float or double) in output frame coordinates, added to each
     * output pixel's centre before mapping; pixels outside it get no displacement. */
    const Plx_Image *displacement;
    const WarpColourCorrection *colour_correction;
    /* Nonzero: a pixel whose 2x2 neighbourhood leaves the source takes the nearest source
     * pixel when that pixel is valid (bit set in the source mask, or no mask). */
    uint32_t border_fill;
    /* Three floats (a, b, c) per output pixel (a 3D vector field or RGB image of type
     * float), in output frame coordinates: the motion-blur ellipse [[a, b], [b, c]] of the
     * high-quality path; when set the output region is not clipped to the source. */
    const Plx_Image *blur;
    /* Output window in output frame coordinates; a width of 0 means none. */
    int32_t window_x, window_y, window_width, window_height;
    /* High-quality path: weight colour by the sample's alpha (only when the output has an
     * alpha channel), or by 1 - alpha. */
    uint32_t alpha_weighting, inverse_alpha;
    /* Bit image in source frame coordinates: its active subwindow replaces the source
     * mask's as the source region, and its set pixels may give nearest-pixel fills. */
    const Plx_Image *window_image;
    /* First nonzero: every pixel goes through the high-quality per-pixel fill. The fill
     * option is kept for callers and changes nothing. */
    uint32_t high_quality_fill, fill_option;
    /* Nonzero: the output mask neither skips pixels nor shrinks the output region. */
    uint32_t ignore_output_mask;
    uint64_t reserved;
    /* First nonzero: tiled fast render with square tiles of tile_size pixels (0: 16),
     * aligned on multiples of the tile size in output frame coordinates. */
    uint32_t fast_render, tile_size;
    /* High-quality path with alpha weighting: divide the weight by alpha again, so inverse
     * alpha weighs by (1 - alpha) / alpha (10000 below alpha 0.0001); without inverse alpha
     * the two cancel. */
    uint32_t divide_by_alpha;
} ProjectiveWarpParams;

/* Kinds of the combined mapping. */
#define PROJECTIVE_WARP_PROJECTIVE 0
#define PROJECTIVE_WARP_AFFINE 1
#define PROJECTIVE_WARP_IDENTITY 3

/* Sets every field to zero. */
PLANO_API void vInitProjectiveWarpParams(ProjectiveWarpParams *params);

/* Combines camera A, the homography (A's normalised coordinates to B's) and camera B into the
 * single-precision mapping K_B H K_A^-1 from output pixels to source pixels and its inverse.
 * kind 3 (identity flag 1): both cameras linear and equal, H a multiple of the identity;
 * kind 1: both linear and the bottom row (0, 0, m22): the top rows divided by m22 (rows 0
 * and 1 of the outputs, row 2 set to (0, 0, 1)); kind 0: projective. Lens distortion is not
 * part of this matrix. m22 = 0: code 18; a singular mapping: code 1. Outputs written only on
 * success; inverse, kind and identity may be null. */
PLANO_API Plx_Bool bCombineHomogCameras(const Plx_Camera *camera_a, const Plx_Matrix33 *homography,
                                        const Plx_Camera *camera_b, Plx_Matrix33_f *mapping,
                                        Plx_Matrix33_f *inverse, int32_t *kind, Plx_Bool *identity);

/* Warps source (seen by camera B, valid where source_mask is set; a mask that is the source
 * itself is ignored) into output (seen by camera A) where output_mask is set.
 * background: defines the output region when there is no output mask, and is copied into
 * the output first (converted to its format and type; the output takes its frame offset)
 * when copy_background is nonzero and it is not the output itself. statistics (optional):
 * the number of output pixels written is added to it. host (optional): interrupt query after each
 * band of 16 rows (a nonzero answer ends the warp with success, later rows unwritten; the
 * fast render asks after each row of tiles), progress every 50 rows.
 * Formats grey, grey with alpha, RGB, RGBA and the blue-first pair (else code 39), pixel
 * types bit (grey), unsigned char, unsigned short, int, unsigned int, float, double (else 38).
 * Everything is checked before the output is touched: bad colour-correction mode 12, a
 * displacement image not int/float/double 38 (not a vector field 39), fast render with a
 * displacement image or colour correction 2, a singular mapping 18 (under code-1 records
 * of the combination), an output that is the source or a validity mask that is one of the
 * masks 7. Lens distortion is followed pixel by pixel through the cameras' operations; a
 * point a camera cannot map is left unsampled, any other camera failure stops the warp
 * (code 1) with the rows before it written. */
PLANO_API Plx_Bool bImageProjectiveWarp(const Plx_Image *background, const Plx_Image *output_mask,
                                        const Plx_Camera *camera_a, const Plx_Image *source,
                                        const Plx_Image *source_mask, const Plx_Camera *camera_b,
                                        const Plx_Matrix33 *homography,
                                        const ProjectiveWarpParams *params, Plx_Image *output,
                                        Plx_Image *validity, const ThreadHostInterface *host,
                                        uint32_t *statistics, Plx_Bool copy_background);

/* The same warp split over the host's jobs by output rows; the result is the same bits as
 * the single-threaded warp for any number of jobs. Without a host it runs on the calling
 * thread. The background copy and the validity mask's set-up are done once before the jobs;
 * only the first job reports progress. Job records or the worker list that cannot be allocated: code 5; a failed start or
 * wait: code 1. */
PLANO_API Plx_Bool bImageProjectiveWarpThreaded(
    const Plx_Image *background, const Plx_Image *output_mask, const Plx_Camera *camera_a,
    const Plx_Image *source, const Plx_Image *source_mask, const Plx_Camera *camera_b,
    const Plx_Matrix33 *homography, const ProjectiveWarpParams *params, Plx_Image *output,
    Plx_Image *validity, const ThreadHostInterface *host, uint32_t *statistics,
    Plx_Bool copy_background);

/* One warp as a job record (the first twelve arguments, parameters inline). */
typedef struct ProjectiveWarpJob {
    const Plx_Image *background;
    const Plx_Image *output_mask;
    const Plx_Camera *camera_a;
    const Plx_Image *source;
    const Plx_Image *source_mask;
    const Plx_Camera *camera_b;
    const Plx_Matrix33 *homography;
    ProjectiveWarpParams params;
    Plx_Image *output;
    Plx_Image *validity;
    const ThreadHostInterface *host;
    uint32_t *statistics;
} ProjectiveWarpJob;

/* Job function: bImageProjectiveWarp of a ProjectiveWarpJob with copy-background 1. */
PLANO_API Plx_Bool pfncImageProjectiveWarp(void *job);

/* One warped sample: (x, y) plus the displacement at pixel (floor x, floor y) of the
 * displacement image (frame coordinates), mapped by the homography (null: identity) and
 * projected through camera (null: divided by w), minus 0.5. result receives the bilinear
 * blend in the source's format (one double per channel), normalised (unsigned char / 255,
 * unsigned short / 65535, unsigned int / 4294967295, int, float and double as stored).
 * 1 when a sample was produced; 0 with error code 0 when the 2x2 neighbourhood is not inside
 * the source or not all set in the mask, or with the camera's code when the projection
 * fails. An unsupported type or format gives 38 or 39: written into error_code when given,
 * otherwise registered. */
PLANO_API Plx_Bool bImagePixelProjectiveWarp(double x, double y, const Plx_Image *source,
                                             const Plx_Image *source_mask,
                                             const Plx_Camera *camera,
                                             const Plx_Matrix33 *homography,
                                             const Plx_Image *displacement, double *result,
                                             int32_t *error_code);
/* The same in single precision. */
PLANO_API Plx_Bool bImagePixelProjectiveWarpFloat(float x, float y, const Plx_Image *source,
                                                  const Plx_Image *source_mask,
                                                  const Plx_Camera_f *camera,
                                                  const Plx_Matrix33_f *homography,
                                                  const Plx_Image *displacement, float *result,
                                                  int32_t *error_code);

/* For every set pixel of the mask's active subwindow, the displacement from its centre to
 * where the warp's mapping (cameras and homography, distortion included) puts it, stored at
 * the same frame position of flow (a 2D vector field of int, float or double; formed as a
 * zeroed float field of the mask's size and offset when it has no pixels). A projective w of
 * 0: code 18; a camera failure: code 1. */
PLANO_API Plx_Bool bHomogToFlow(const Plx_Image *mask, const Plx_Camera *camera_a,
                                const Plx_Matrix33 *homography, const Plx_Camera *camera_b,
                                Plx_Image *flow);

#ifdef __cplusplus
}
#endif

#endif
