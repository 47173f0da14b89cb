// The scan-line filler of bit images and the edge collection behind every hard fill.
#include <cfloat>
#include <cmath>

#include "common/internal.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "pixmap/pixmap_spans.hpp"
#include "plano/polygon_fill.h"

namespace plano::pixmap {

namespace {

// Keeps the integer edge table bounded whatever the coordinates.
constexpr double kClip = 30000.0;

struct Point {
    double x, y;
};

// Clips the edge p-q against one side of the line coordinate = limit (sign +1: keeps what is
// at or below it; -1: at or above) and passes the pieces on. The part beyond the line is not
// dropped but pressed onto it, so neighbouring edges still meet and every row keeps an even
// number of crossings. axis 0 clips x, 1 clips y.
template <class Next>
void clip_side(Point p, Point q, int axis, double limit, double sign, Next &&next)
{
    auto c = [axis](const Point &v) { return axis == 0 ? v.x : v.y; };
    auto pressed = [axis, limit](Point v) {
        (axis == 0 ? v.x : v.y) = limit;
        return v;
    };
    const bool p_out = sign * (c(p) - limit) > 0.0, q_out = sign * (c(q) - limit) > 0.0;
    if (!p_out && !q_out) return next(p, q);
    if (p_out && q_out) return next(pressed(p), pressed(q));
    const double f = (limit - c(p)) / (c(q) - c(p));
    const Point m = pressed(Point{p.x + f * (q.x - p.x), p.y + f * (q.y - p.y)});
    if (p_out) {
        next(pressed(p), m);
        next(m, q);
    } else {
        next(p, m);
        next(m, pressed(q));
    }
}

void add_clipped(Point p, Point q, int32_t offset_x, int32_t offset_y, std::vector<ScanEdge> &edges)
{
    // Truncation toward zero happens in frame coordinates, before the offset comes off; the
    // clip keeps the differences within 32 bits even where the frame coordinates are not.
    auto local = [](double v, int32_t offset) { return int32_t(std::trunc(v) - double(offset)); };
    ScanEdge e{local(p.x, offset_x), local(p.y, offset_y), local(q.x, offset_x), local(q.y, offset_y)};
    if (e.y0 == e.y1) return;
    if (e.y0 > e.y1) e = ScanEdge{e.x1, e.y1, e.x0, e.y0};
    edges.push_back(e);
}

void add_edge(Point p, Point q, int32_t offset_x, int32_t offset_y, std::vector<ScanEdge> &edges)
{
    if (std::isnan(p.x) || std::isnan(p.y) || std::isnan(q.x) || std::isnan(q.y)) return;
    // An infinite vertex stands for the farthest float: its edges are then clipped like any
    // long edge, and the rows they span keep their crossings.
    for (double *v : {&p.x, &p.y, &q.x, &q.y}) *v = std::fmax(-FLT_MAX, std::fmin(FLT_MAX, *v));
    const double x0 = offset_x - kClip, x1 = offset_x + kClip, y0 = offset_y - kClip, y1 = offset_y + kClip;
    clip_side(p, q, 0, x0, -1.0, [&](Point a, Point b) {
        clip_side(a, b, 0, x1, 1.0, [&](Point c, Point d) {
            clip_side(c, d, 1, y0, -1.0, [&](Point e, Point f) {
                clip_side(e, f, 1, y1, 1.0, [&](Point g, Point h) { add_clipped(g, h, offset_x, offset_y, edges); });
            });
        });
    });
}

}  // namespace

bool collect_scan_edges(const Polygon2D *polygon, int32_t offset_x, int32_t offset_y, std::vector<ScanEdge> &edges)
{
    try {
        edges.clear();
        for (const Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next)
            add_edge(Point{e->x, e->y}, Point{e->end_x, e->end_y}, offset_x, offset_y, edges);
        // An outline left open still encloses the area its closing edge would bound.
        if (polygon->head != nullptr && !is_closed(polygon))
            add_edge(Point{polygon->tail->end_x, polygon->tail->end_y}, Point{polygon->head->x, polygon->head->y},
                     offset_x, offset_y, edges);
    } catch (...) {
        register_alloc_failure("bGET_Insert", (edges.size() + 1) * sizeof(ScanEdge));
        return false;
    }
    return true;
}

bool fill_bits(Plx_Image *image, const Polygon2D *polygon, uint32_t value, uint32_t mode, const char *function)
{
    if (mode > 2) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "fill mode", int64_t(mode));
        return false;
    }
    const BitOp op = mode != 0 ? BitOp::invert : value != 0 ? BitOp::set : BitOp::clear;
    return fill_spans(image, polygon, function, [image, op](int32_t y, int32_t first, int32_t last) {
        apply_bits(static_cast<uint32_t *>(plx_image_row(image, y)), first, last, op);
    });
}

bool check_bit_image(const Plx_Image *image, const char *function)
{
    if (!check_image(image, function)) return false;
    if (image->type != PLX_TYPE_BIT) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_PIXEL_TYPE, "not a bit image", int64_t(image->type));
        return false;
    }
    return true;
}

}  // namespace plano::pixmap

extern "C" {

PLANO_API Plx_Bool bImageFillPolygonBinaryImage(Plx_Image *image, const Polygon2D *polygon, uint32_t value,
                                                uint32_t mode)
{
    using namespace plano::pixmap;
    if (!check_polygon(polygon) || !check_bit_image(image, __func__)) return 0;
    return fill_bits(image, polygon, value, mode, __func__) ? 1 : 0;
}

}  // extern "C"
