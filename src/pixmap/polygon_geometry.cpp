// Geometry on a Polygon2D outline: collapsing small self-crossing loops, spreading bunched
// points, and the crossing of a segment with the outline.
#include <cmath>
#include <vector>

#include "common/internal.hpp"
#include "pixmap/pixmap_internal.hpp"

namespace {

using plano::pixmap::Crossing;
using plano::pixmap::edges_cross;
using plano::pixmap::segment_of;

// The records of the outline in order, so that vertices can be addressed by index.
bool records_of(const Polygon2D *polygon, std::vector<Polygon2DEdge *> &records, const char *function)
{
    try {
        records.clear();
        for (Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next) records.push_back(e);
    } catch (...) {
        PLX_ERR_START_AS(function, PLX_ERROR_MALLOC_FAILED, "", int64_t(records.size() * sizeof(void *)));
        return false;
    }
    return true;
}

// Moves vertex k (record k's start and its predecessor's end) to the given place. Vertex 0
// is also the tail's end only on a closed outline.
void move_vertex(std::vector<Polygon2DEdge *> &records, std::size_t k, bool closed, float x, float y, float width,
                 float t)
{
    const std::size_t n = records.size();
    Polygon2DEdge *e = records[k];
    e->x = x, e->y = y, e->start_width = width, e->start_t = t;
    if (k > 0 || closed) {
        Polygon2DEdge *p = records[(k + n - 1) % n];
        p->end_x = x, p->end_y = y, p->end_width = width, p->end_t = t;
    }
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bPolygon2DRemoveCrossingPoints(Polygon2D *polygon, uint32_t height, uint32_t width)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    std::vector<Polygon2DEdge *> records;
    if (!records_of(polygon, records, __func__)) return 0;
    const std::size_t n = records.size();
    if (n < 4) return 1;
    const bool closed = plano::pixmap::is_closed(polygon);
    auto in_rect = [height, width](float x, float y) {
        return x >= 0.0f && x <= float(width) && y >= 0.0f && y <= float(height);
    };
    // Runs of consecutive records near the rectangle: [first, first + length).
    struct Run {
        std::size_t first, length;
    };
    std::vector<Run> runs;
    try {
        for (std::size_t i = 0; i < n; ++i) {
            const Polygon2DEdge *e = records[i];
            if (!in_rect(e->x, e->y) && !in_rect(e->end_x, e->end_y)) continue;
            if (!runs.empty() && runs.back().first + runs.back().length == i)
                ++runs.back().length;
            else
                runs.push_back(Run{i, 1});
        }
    } catch (...) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "run entry", int64_t(sizeof(Run)));
        return 0;
    }
    // Collapses vertices first+1 .. last (round the outline) onto the crossing.
    auto collapse = [&](std::size_t first, std::size_t last, const Crossing &c) {
        for (std::size_t k = (first + 1) % n;; k = (k + 1) % n) {
            move_vertex(records, k, closed, float(c.x), float(c.y), float(c.width), float(c.t));
            if (k == last) break;
        }
    };
    for (std::size_t r = 0; r < runs.size(); ++r) {
        const Run &run = runs[r];
        for (std::size_t i = run.first; i < run.first + run.length; ++i) {
            const plano::pixmap::Segment a = segment_of(*records[i]);
            Crossing c{};
            std::size_t hit = n;
            for (std::size_t j = i + 2; j < run.first + run.length && hit == n; ++j)
                if (edges_cross(a, segment_of(*records[j]), &c)) hit = j;
            for (std::size_t q = 0; q < runs.size() && hit == n; ++q) {
                if (q == r) continue;
                for (std::size_t j = runs[q].first; j < runs[q].first + runs[q].length && hit == n; ++j)
                    if (edges_cross(a, segment_of(*records[j]), &c)) hit = j;
            }
            if (hit == n) continue;
            const std::size_t distance = (hit + n - i) % n;
            if (2 * distance < n) {
                collapse(i, hit, c);  // the loop i -> hit is the small one
            } else {
                collapse(hit, i, c);  // the loop through the head is the small one
                return 1;
            }
        }
    }
    return 1;
}

PLANO_API Plx_Bool bPolygon2DSeparatePoints(Polygon2D *polygon, float distance)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    std::vector<Polygon2DEdge *> records;
    if (!records_of(polygon, records, __func__)) return 0;
    const std::size_t n = records.size();
    if (n == 0) return 1;
    const double d = distance;
    const bool closed = plano::pixmap::is_closed(polygon);
    std::vector<double> ux, uy;
    std::vector<char> is_short;
    try {
        ux.resize(n), uy.resize(n), is_short.resize(n);
    } catch (...) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "", int64_t(n * 17));
        return 0;
    }
    std::size_t first_long = n;
    for (std::size_t k = 0; k < n; ++k) {
        const Polygon2DEdge *e = records[k];
        const float dx = e->end_x - e->x, dy = e->end_y - e->y;
        is_short[k] = std::fabs(double(dx)) <= d && std::fabs(double(dy)) <= d;
        const double len = std::hypot(double(dx), double(dy));
        ux[k] = len > 0.0 ? dx / len : 0.0;
        uy[k] = len > 0.0 ? dy / len : 0.0;
        if (!is_short[k] && first_long == n) first_long = k;
    }
    if (first_long == n) return 1;
    std::size_t a = first_long, m = 0;
    for (std::size_t step = 1; step <= n; ++step) {
        const std::size_t b = (first_long + step) % n;
        if (is_short[b]) {
            ++m;
            continue;
        }
        if (m > 0) {
            double sx = ux[a] + ux[b], sy = uy[a] + uy[b];
            const double len = std::hypot(sx, sy);
            if (len > 0.0)
                sx = sx / len * d, sy = sy / len * d;
            else
                sx = d, sy = 0.0;
            // Spread the m + 1 vertices from a's end to b's start evenly about where they
            // were, distance d apart in all.
            for (std::size_t k = 0; k <= m; ++k) {
                const double f = -0.5 + double(k) / double(m);
                const std::size_t v = (a + 1 + k) % n;
                Polygon2DEdge *e = records[v];
                move_vertex(records, v, closed, float(e->x + f * sx), float(e->y + f * sy), e->start_width,
                            e->start_t);
            }
        }
        a = b;
        m = 0;
    }
    return 1;
}

PLANO_API Plx_Bool bIntersectLineWithPolygon(const Plx_Vector2_f *start, const Plx_Vector2_f *end,
                                             const Polygon2D *polygon, const Polygon2DEdge *first,
                                             Plx_Vector2_f *crossing)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    if (start == nullptr || end == nullptr || crossing == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null point", 0);
        return 0;
    }
    if (polygon->head == nullptr) return 0;
    if (first == nullptr) first = polygon->head;
    const uint32_t n = uiPolygon2DNumberOfPoints(polygon);
    const plano::pixmap::Segment line{start->x, start->y, end->x, end->y, 0, 0, 0, 0};
    const Polygon2DEdge *back = first, *ahead = first;
    Crossing c{};
    // Nearest edges first: the record, then alternately further back and further ahead.
    for (uint32_t tested = 0; tested < n; ++tested) {
        const Polygon2DEdge *e = first;
        if (tested > 0 && tested % 2 == 1) {
            back = back->previous != nullptr ? back->previous : polygon->tail;
            e = back;
        } else if (tested > 0) {
            ahead = ahead->next != nullptr ? ahead->next : polygon->head;
            e = ahead;
        }
        if (edges_cross(line, segment_of(*e), &c)) {
            crossing->x = float(c.x);
            crossing->y = float(c.y);
            return 1;
        }
    }
    return 0;
}

}  // extern "C"
