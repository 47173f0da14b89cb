// Argument checks and failure records shared by the polygon and rasterisation entry points.
#include "common/internal.hpp"
#include "pixmap/pixmap_internal.hpp"

namespace plano::pixmap {

bool check_polygon(const Polygon2D *polygon, const char *function)
{
    if (polygon != nullptr) return true;
    PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null polygon", 0);
    return false;
}

bool check_image(const Plx_Image *image, const char *function)
{
    if (image != nullptr && image->width >= 0 && image->height >= 0 &&
        (image->data != nullptr || image->width == 0 || image->height == 0))
        return true;
    PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null or unformed image", 0);
    return false;
}

void register_alloc_failure(const char *step, std::size_t bytes)
{
    PLX_ERR_START_AS(step, PLX_ERROR_MALLOC_FAILED, "", int64_t(bytes));
}

bool edges_cross(const Segment &a, const Segment &b, Crossing *crossing)
{
    const double ax = a.x1 - a.x0, ay = a.y1 - a.y0, bx = b.x1 - b.x0, by = b.y1 - b.y0;
    const double den = ax * by - ay * bx;
    if (den == 0.0) return false;
    const double qx = b.x0 - a.x0, qy = b.y0 - a.y0;
    const double ta = (qx * by - qy * bx) / den;  // fraction along a from its start
    const double tb = (qx * ay - qy * ax) / den;  // fraction along b from its start
    const double x = a.x0 + ta * ax, y = a.y0 + ta * ay;
    auto strictly_inside = [x, y](const Segment &s, double dx, double dy) {
        if (std::fabs(dx) > std::fabs(dy)) return std::fmin(s.x0, s.x1) < x && x < std::fmax(s.x0, s.x1);
        return std::fmin(s.y0, s.y1) < y && y < std::fmax(s.y0, s.y1);
    };
    if (!strictly_inside(a, ax, ay) || !strictly_inside(b, bx, by)) return false;
    if (crossing != nullptr) {
        // Fractions measured from each edge's end, 1 at its start.
        const double sa = 1.0 - ta, sb = 1.0 - tb;
        crossing->x = x;
        crossing->y = y;
        crossing->width = ((a.w0 - a.w1) * sa + a.w1 + (b.w0 - b.w1) * sb + b.w1) / 2.0;
        crossing->t = ((a.t0 - a.t1) * sa + a.t1 + (b.t0 - b.t1) * sb + b.t1) / 2.0;
    }
    return true;
}

}  // namespace plano::pixmap
