// Polygon2D: building, closing, editing, copying and bounding the edge chain.
#include <cfloat>
#include <cmath>
#include <cstdlib>

#include "common/internal.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "plano/polygon.h"

namespace {

void take_end_from_start(Polygon2DEdge *edge, const Polygon2DEdge *from)
{
    edge->end_x = from->x;
    edge->end_y = from->y;
    edge->end_width = from->start_width;
    edge->end_t = from->start_t;
}

// Links a new record after the tail, making the old tail run to it.
void append(Polygon2D *polygon, Polygon2DEdge *edge)
{
    Polygon2DEdge *tail = polygon->tail;
    edge->next = nullptr;
    edge->previous = tail;
    if (tail == nullptr) {
        polygon->head = edge;
    } else {
        take_end_from_start(tail, edge);
        tail->next = edge;
    }
    polygon->tail = edge;
}

// Unlinks and frees the tail.
void drop_tail(Polygon2D *polygon)
{
    Polygon2DEdge *tail = polygon->tail;
    polygon->tail = tail->previous;
    if (polygon->tail != nullptr)
        polygon->tail->next = nullptr;
    else
        polygon->head = nullptr;
    std::free(tail);
}

}  // namespace

extern "C" {

PLANO_API Polygon2D *pPolygon2DNew(void)
{
    Polygon2D *polygon = PLX_ALLOC(Polygon2D, 1);
    if (polygon == nullptr) return nullptr;
    *polygon = Polygon2D{nullptr, nullptr, 0.0f, 1u, nullptr};
    return polygon;
}

PLANO_API void vPolygon2DSetDistanceThreshold(Polygon2D *polygon, float distance)
{
    if (polygon != nullptr) polygon->distance_threshold_squared = distance * distance;
}

PLANO_API void vPolygon2DSetEdgeSense(Polygon2D *polygon, uint32_t sense)
{
    if (polygon != nullptr) polygon->edge_sense = sense;
}

PLANO_API void vPolygon2DSetAlphaFunc(Polygon2D *polygon, Polygon2DAlphaFunc function)
{
    if (polygon != nullptr) polygon->alpha_func = function;
}

PLANO_API Plx_Bool bPolygon2DAddWidePointWithT(Polygon2D *polygon, float y, float x, float width, float t)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    const Polygon2DEdge *tail = polygon->tail;
    if (polygon->distance_threshold_squared > 0.0f && tail != nullptr) {
        const float dy = y - tail->y, dx = x - tail->x, dw = width - tail->end_width;
        if (dy * dy + dx * dx + dw * dw <= polygon->distance_threshold_squared) return 1;
    }
    auto *edge = static_cast<Polygon2DEdge *>(std::malloc(sizeof(Polygon2DEdge)));
    if (edge == nullptr) {
        // The registered name keeps the spelling callers already match on.
        PLX_ERR_START_AS("bPolygon2DAddWidtPointWithT", PLX_ERROR_MALLOC_FAILED, "", int64_t(sizeof(Polygon2DEdge)));
        return 0;
    }
    *edge = Polygon2DEdge{x, y, x, y, width, width, t, t, nullptr, nullptr};
    append(polygon, edge);
    return 1;
}

PLANO_API Plx_Bool bPolygon2DScalePoints(Polygon2D *polygon, float sy, float sx)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    const float sw = (sx + sy) / 2.0f;
    for (Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next) {
        e->x *= sx;
        e->end_x *= sx;
        e->y *= sy;
        e->end_y *= sy;
        e->start_width *= sw;
        e->end_width *= sw;
    }
    return 1;
}

PLANO_API Plx_Bool bPolygon2DClose(Polygon2D *polygon)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    if (polygon->head == nullptr) return 1;
    if (polygon->distance_threshold_squared > 0.0f && polygon->head != polygon->tail) {
        const float dy = polygon->head->y - polygon->tail->y, dx = polygon->head->x - polygon->tail->x;
        if (dy * dy + dx * dx < polygon->distance_threshold_squared) drop_tail(polygon);
    }
    take_end_from_start(polygon->tail, polygon->head);
    return 1;
}

PLANO_API Plx_Bool bPolygon2DFinishOpen(Polygon2D *polygon)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    if (polygon->head != polygon->tail) drop_tail(polygon);
    return 1;
}

PLANO_API Plx_Bool bPolygon2DDeleteNextEdge(Polygon2D *polygon, Polygon2DEdge *record)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    if (record == nullptr || polygon->head == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "no record", 0);
        return 0;
    }
    if (polygon->head == polygon->tail) {
        // The only record is the head, whatever the caller holds.
        std::free(polygon->head);
        polygon->head = polygon->tail = nullptr;
        return 1;
    }
    Polygon2DEdge *dropped = record->next != nullptr ? record->next : polygon->head;
    Polygon2DEdge *after = dropped->next != nullptr ? dropped->next : polygon->head;
    take_end_from_start(record, after);
    // Unlink the dropped record from wherever it sits in the (non-circular) chain.
    if (dropped->previous != nullptr)
        dropped->previous->next = dropped->next;
    else
        polygon->head = dropped->next;
    if (dropped->next != nullptr)
        dropped->next->previous = dropped->previous;
    else
        polygon->tail = dropped->previous;
    std::free(dropped);
    return 1;
}

PLANO_API void vPolygon2DDelete(Polygon2D *polygon)
{
    if (polygon == nullptr) return;
    for (Polygon2DEdge *e = polygon->head; e != nullptr;) {
        Polygon2DEdge *next = e->next;
        std::free(e);
        e = next;
    }
    std::free(polygon);
}

PLANO_API uint32_t uiPolygon2DNumberOfPoints(const Polygon2D *polygon)
{
    uint32_t n = 0;
    if (polygon != nullptr)
        for (const Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next) ++n;
    return n;
}

PLANO_API Polygon2D *pPolygon2DCopy(const Polygon2D *polygon)
{
    if (!plano::pixmap::check_polygon(polygon)) return nullptr;
    Polygon2D *copy = pPolygon2DNew();
    if (copy == nullptr) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "", int64_t(sizeof(Polygon2D)));
        return nullptr;
    }
    for (const Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next) {
        if (!bPolygon2DAddWidePointWithT(copy, e->y, e->x, e->start_width, e->start_t)) {
            vPolygon2DDelete(copy);
            PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "", int64_t(sizeof(Polygon2DEdge)));
            return nullptr;
        }
    }
    if (copy->tail != nullptr) {
        const Polygon2DEdge *last = polygon->tail;
        Polygon2DEdge *tail = copy->tail;
        tail->end_x = last->end_x, tail->end_y = last->end_y;
        tail->end_width = last->end_width, tail->end_t = last->end_t;
    }
    return copy;
}

PLANO_API Plx_Bool bPolygon2DGetBoundingBox(const Polygon2D *polygon, uint32_t box[4])
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    if (box == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null box", 0);
        return 0;
    }
    float min_x = FLT_MAX, min_y = FLT_MAX, max_x = -100000.0f, max_y = -100000.0f;
    for (const Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next) {
        min_x = std::fmin(min_x, e->x);
        min_y = std::fmin(min_y, e->y);
        max_x = std::fmax(max_x, e->end_x);
        max_y = std::fmax(max_y, e->end_y);
    }
    if (polygon->head == nullptr || min_x >= max_x || min_y > max_y) {
        PLX_ERR_START(PLX_ERROR_NO_DATA, "empty polygon", 0);
        return 0;
    }
    // Beyond this the integer box would overflow its 32 bits.
    constexpr float kLimit = 1.0e9f;
    if (!(min_x > -kLimit && min_y > -kLimit && max_x < kLimit && max_y < kLimit)) {
        PLX_ERR_START(PLX_ERROR_OUTSIDE_RANGE, "coordinates beyond 1e9", 0);
        return 0;
    }
    const int32_t x = int32_t(std::trunc(min_x)), y = int32_t(std::trunc(min_y));
    box[0] = uint32_t(x);
    box[1] = uint32_t(y);
    box[2] = uint32_t(int32_t(std::trunc(max_x)) - x + 1);
    box[3] = uint32_t(int32_t(std::trunc(max_y)) - y + 1);
    return 1;
}

}  // extern "C"
