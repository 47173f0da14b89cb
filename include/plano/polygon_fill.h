/* Filling Polygon2D outlines into images, and drawing lines.
 *
 * Polygon coordinates are in the frame of the whole picture: every filler and drawer takes
 * off the image's frame offset (x, y) before addressing pixels and clips to the image.
 *
 * Hard fills (bit images, and any image when no edge has a width) follow one rule: vertices
 * are truncated toward zero in frame coordinates, and pixel (c, r) is filled when the point
 * (c, r) lies inside that truncated outline by the even-odd rule, points on its left and top
 * boundary (smaller column, smaller row) counting inside and on its right and bottom boundary
 * outside (so a square from (0, 0) to (4, 4) fills columns and rows 0..3). An outline whose
 * tail does not end at its head is filled as if closed. Coordinates more than 30000 pixels
 * from the image's origin are first pressed onto that distance, which bounds the tables.
 *
 * Feathered fills ramp every edge over its edge widths, sampling each pixel at its centre.
 * The value is 1 fully inside and 0 fully outside; where the ramp lies is the polygon's edge
 * sense: 0 wholly outside the outline, 1 centred on it (0.5 on the line), 2 wholly inside.
 * A value is never lowered outside the outline nor raised inside it, so the order of the
 * edges does not matter.
 *
 * Pixels are given as one double per channel in the image's own format and scale (255 for a
 * full unsigned char, 1.0 for a full float; a bit is set from 0.5). */
#ifndef PLANO_POLYGON_FILL_H
#define PLANO_POLYGON_FILL_H

#include "pellux/camera.h"
#include "pellux/image.h"
#include "plano/plano_base.h"
#include "plano/polygon.h"
#include "plano/threads.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Receives a feather value before the alpha function and the mid T of the edge that wrote it;
 * returns what the T image stores. */
typedef float (*Polygon2DTFunc)(float value, float t);

/* Scan-line fill of a bit image: mode 0 writes value (0 or 1), modes 1 and 2 invert the
 * covered bits (so filling twice restores the image); other modes fail with code 12. */
PLANO_API Plx_Bool bImageFillPolygonBinaryImage(Plx_Image *image, const Polygon2D *polygon, uint32_t value,
                                                uint32_t mode);
/* Feathered fill of a float grey image. inside: a bit image of alpha's size saying which
 * pixels are inside the outline (null: the polygon's own hard fill). The image is set to 1.0
 * inside and 0.0 outside, then every edge is ramped. When t_image (float grey, alpha's size)
 * and t_func are given, each pixel the ramp writes gets t_func(value, mid T of the edge). */
PLANO_API Plx_Bool bImageFillPolygonAlpha(Plx_Image *alpha, const Plx_Image *inside, const Polygon2D *polygon,
                                          Plx_Image *t_image, Polygon2DTFunc t_func);
/* The same, split into bands of rows over the host's jobs; the result does not depend on the
 * number of jobs. A null host runs on the calling thread. The polygon's alpha function and
 * t_func are then called from several threads at once. */
PLANO_API Plx_Bool bImageFillPolygonAlphaThreaded(Plx_Image *alpha, const Plx_Image *inside,
                                                  const Polygon2D *polygon, Plx_Image *t_image,
                                                  Polygon2DTFunc t_func, const ThreadHostInterface *host);
/* Fills any image with pixel. Bit images: the scan-line fill with the pixel's bit and mode.
 * Other images take mode 0 only (code 32, "unsupported"): hard when no edge has a width, else
 * (grey images only: other formats code 12) blended as (1 - a) old + a pixel by the feather
 * value a. */
PLANO_API Plx_Bool bImageFillPolygon(Plx_Image *image, const Polygon2D *polygon, const double *pixel, uint32_t mode);
/* Grows the set pixels of a bit image by n pixels in a square neighbourhood; a negative n
 * shrinks them by -n; 0 does nothing. */
PLANO_API Plx_Bool bExpandMatte(Plx_Image *image, int32_t n);
/* The four corners of the feather bands of one edge S -> E: the edge's normal, averaged with
 * the previous edge's at S and with the next edge's at E (the edge's own without that
 * neighbour), scaled by the start and end width. A zero-length edge, or a neighbour folding
 * straight back, gives the plain outline points. */
PLANO_API Plx_Bool bBuildPointsEitherSideOfLine(const Polygon2DEdge *edge, const Polygon2DEdge *previous,
                                                const Polygon2DEdge *next, Plx_Vector2_f *start_minus,
                                                Plx_Vector2_f *end_minus, Plx_Vector2_f *start_plus,
                                                Plx_Vector2_f *end_plus);
/* Which of the directions origin->a and origin->b leads into the set region of a mask (bit
 * image, or unsigned-char grey where nonzero is set), probing 1..5 pixels out: 0 for a, 1 for
 * b, 2 undecided. A zero-length direction fails with code 18, other pixel types with 12. */
PLANO_API Plx_Bool bDetermineInwardsDirection(const Plx_Image *image, const Plx_Vector2_f *origin,
                                              const Plx_Vector2_f *a, const Plx_Vector2_f *b, uint32_t *result);
/* Ramps the band between two outlines with corresponding points (point i of one matches point
 * i of the other) into a grey image: each band pixel takes the value rising from 0 on the
 * outer outline to full scale on the inner one, where that is above what it holds. Seams
 * between neighbouring quadrilaterals are covered once, through two scratch bit masks of the
 * image's size: pass both or neither (code 32). */
PLANO_API Plx_Bool bFillPolygonSoftEdge(const Polygon2D *inner, const Polygon2D *outer, Plx_Image *image,
                                        Plx_Image *scratch_a, Plx_Image *scratch_b);
/* Multiplies the pixels of the band S-E-b-a of an unsigned-char grey image by the position
 * across it (0 on S-E, 1 on a-b); beyond S-E, pixels up to half the band's width away are
 * cleared. Only the whole pixels of the corners' box widened by two on each side are
 * visited. */
PLANO_API Plx_Bool bFillQuadrilateralWithRampGreyUchar(Plx_Image *image, const Plx_Vector2_f *a,
                                                       const Plx_Vector2_f *b, const Plx_Vector2_f *s,
                                                       const Plx_Vector2_f *e);
/* A straight line from row y0, column x0 to row y1, column x1 (frame coordinates), thickness
 * pixels wide across its main direction (thickness 0: code 7). */
PLANO_API Plx_Bool bImageDrawLine(Plx_Image *image, int32_t y0, int32_t x0, int32_t y1, int32_t x1,
                                  const double *pixel, uint32_t thickness);
/* Every edge of the polygon as a line. */
PLANO_API Plx_Bool bImageDrawPolygon(Plx_Image *image, const Polygon2D *polygon, const double *pixel,
                                     uint32_t thickness);
/* Image file formats bImageSavePolygon writes. */
typedef enum Polygon2DFileFormat {
    POLYGON2D_FILE_PGM = 0 /* binary portable grey map */
} Polygon2DFileFormat;
/* Draws the outline (value 255, thickness 1) into a cleared unsigned-char image of its
 * bounding box and writes it to a file (code 39 for an unknown format, 25 when the file does
 * not open, 36 when a write fails). */
PLANO_API Plx_Bool bImageSavePolygon(const char *file_name, uint32_t file_format, const Polygon2D *polygon);
/* Samples the straight line start -> end of normalised camera coordinates every 0.1 through
 * the camera's projection (with its distortion) and appends the pixels with width 0, T 0.
 * A line whose length is not a number or too long to count draws nothing; one that needs
 * more than 1e7 samples fails with code 32. */
PLANO_API Plx_Bool bPolygonRenderLine(Polygon2D *polygon, const Plx_Camera *camera, const double start[2],
                                      const double end[2]);
/* The same for a 3D segment in the camera's frame, first cut to the part in front of the
 * camera within four times the extents (extent_x, extent_y pixels about the principal point)
 * of its view; code 7 when no part qualifies. */
PLANO_API Plx_Bool bPolygonRenderLineCombined(Polygon2D *polygon, const Plx_Camera *camera, const double start[3],
                                              const double end[3], double extent_x, double extent_y);

#ifdef __cplusplus
}
#endif

#endif
