/* Polygon2D: the one polygon type of the engine.
 *
 * A doubly linked chain of edge records in single precision. Record i runs from vertex i to
 * vertex i+1 and carries the edge (feather) width and the curve parameter T at both ends;
 * its end fields are a copy of its successor's start fields. While points are being added the
 * tail's end equals its start; bPolygon2DClose then joins the tail to the head (a closed
 * outline of n edges) and bPolygon2DFinishOpen drops the tail (an open polyline of n - 1
 * edges). The chain itself is never circular: walking stops at a null next pointer.
 *
 * Coordinates are in the frame of the whole picture; x is the column direction, y the row
 * direction. The polygon also holds the settings of how it is built and filled: a distance
 * threshold that thins out points as they are added, the edge sense (where the feather lies:
 * 0 outside the outline, 1 centred on it, 2 inside) and an alpha function that reshapes the
 * feather ramp (null: identity).
 *
 * Null polygons or records given to b... functions fail with code 32; v... functions ignore
 * them. */
#ifndef PLANO_POLYGON_H
#define PLANO_POLYGON_H

#include "pellux/fixed.h"
#include "plano/plano_base.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Maps a feather value in [0, 1] before it is written. */
typedef float (*Polygon2DAlphaFunc)(float value);

typedef struct Polygon2DEdge {
    float x, y;                   /* start of the edge (the vertex) */
    float end_x, end_y;           /* end of the edge (the next vertex) */
    float start_width, end_width; /* edge width at the start and at the end */
    float start_t, end_t;         /* curve parameter at the start and at the end */
    struct Polygon2DEdge *next;     /* null at the tail */
    struct Polygon2DEdge *previous; /* null at the head */
} Polygon2DEdge;

typedef struct Polygon2D {
    Polygon2DEdge *head, *tail;
    float distance_threshold_squared; /* 0 keeps every point */
    uint32_t edge_sense;              /* 0 outside, 1 centred (default), 2 inside */
    Polygon2DAlphaFunc alpha_func;    /* null: identity */
} Polygon2D;

/* An empty polygon with the default settings; null with code 5 when out of memory. */
PLANO_API Polygon2D *pPolygon2DNew(void);
/* Stores distance squared: a point added within that distance of the tail (x, y and width
 * together) is dropped. */
PLANO_API void vPolygon2DSetDistanceThreshold(Polygon2D *polygon, float distance);
PLANO_API void vPolygon2DSetEdgeSense(Polygon2D *polygon, uint32_t sense);
PLANO_API void vPolygon2DSetAlphaFunc(Polygon2D *polygon, Polygon2DAlphaFunc function);
/* Appends a vertex. Note the order: the row coordinate y comes before the column x. */
PLANO_API Plx_Bool bPolygon2DAddWidePointWithT(Polygon2D *polygon, float y, float x, float width, float t);
/* Scales every start and end x by sx and y by sy, and both widths by (sx + sy) / 2. */
PLANO_API Plx_Bool bPolygon2DScalePoints(Polygon2D *polygon, float sy, float sx);
/* Joins the tail to the head, first dropping a tail within the threshold of the head. */
PLANO_API Plx_Bool bPolygon2DClose(Polygon2D *polygon);
/* Ends an open polyline: the tail record is dropped (its predecessor already ends there). */
PLANO_API Plx_Bool bPolygon2DFinishOpen(Polygon2D *polygon);
/* Removes the vertex after record (the head's vertex when record is the tail); the record
 * then runs to the vertex after the removed one. */
PLANO_API Plx_Bool bPolygon2DDeleteNextEdge(Polygon2D *polygon, Polygon2DEdge *record);
/* Frees every record and the polygon. */
PLANO_API void vPolygon2DDelete(Polygon2D *polygon);
PLANO_API uint32_t uiPolygon2DNumberOfPoints(const Polygon2D *polygon);
/* Collapses small self-crossing loops of a closed outline onto their crossing point, looking
 * only at edges near the rectangle 0 <= x <= width, 0 <= y <= height. Records are moved,
 * never freed. */
PLANO_API Plx_Bool bPolygon2DRemoveCrossingPoints(Polygon2D *polygon, uint32_t height, uint32_t width);
/* A copy of the points with default settings (a closed source gives a closed copy). */
PLANO_API Polygon2D *pPolygon2DCopy(const Polygon2D *polygon);
/* Spreads each run of bunched vertices (edges no longer than distance in x and y) evenly
 * over a length of distance along the direction of the outline around it, centred on where
 * the run was. */
PLANO_API Plx_Bool bPolygon2DSeparatePoints(Polygon2D *polygon, float distance);
/* The first crossing of the segment start-end with the outline, testing the edges nearest
 * to record first (record, its predecessor, its successor, ...). Returns 0 without an error
 * record when there is none; crossings exactly at a vertex are not reported. */
PLANO_API Plx_Bool bIntersectLineWithPolygon(const Plx_Vector2_f *start, const Plx_Vector2_f *end,
                                             const Polygon2D *polygon, const Polygon2DEdge *first,
                                             Plx_Vector2_f *crossing);
/* Integer box of the outline: box[0] = x, box[1] = y, box[2] = width, box[3] = height, the
 * corners truncated toward zero. An empty polygon, or one without horizontal extent, fails
 * with code 23. */
PLANO_API Plx_Bool bPolygon2DGetBoundingBox(const Polygon2D *polygon, uint32_t box[4]);

#ifdef __cplusplus
}
#endif

#endif
