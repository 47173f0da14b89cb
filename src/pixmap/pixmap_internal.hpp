// Helpers shared by the polygon and rasterisation sources: argument checks, the edge
// crossing test, and the scan converter every hard fill runs on.
#ifndef PLANO_SRC_PIXMAP_PIXMAP_INTERNAL_HPP
#define PLANO_SRC_PIXMAP_PIXMAP_INTERNAL_HPP

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <vector>

#include "pellux/error.h"
#include "pellux/image.h"
#include "plano/polygon.h"
#include "plano/threads.h"

namespace plano::pixmap {

// Registers code 32 under the calling function when polygon is null.
bool check_polygon(const Polygon2D *polygon, const char *function = __builtin_FUNCTION());
// Registers code 32 under the calling function when image is null or has no pixels while
// claiming a size; images of size 0 pass.
bool check_image(const Plx_Image *image, const char *function = __builtin_FUNCTION());
// Allocation failure of a filler's tables, registered under the step's name.
void register_alloc_failure(const char *step, std::size_t bytes);

// One edge in double precision with its width and T at both ends.
struct Segment {
    double x0, y0, x1, y1;
    double w0, w1, t0, t1;
};
inline Segment segment_of(const Polygon2DEdge &e)
{
    return Segment{e.x, e.y, e.end_x, e.end_y, e.start_width, e.end_width, e.start_t, e.end_t};
}
struct Crossing {
    double x, y, width, t;
};
// Two edges cross when their lines are not parallel and the crossing lies strictly inside
// both, judged on each edge's dominant axis. The crossing carries the mean of the widths
// and of the T values interpolated along each edge.
bool edges_cross(const Segment &a, const Segment &b, Crossing *crossing);

// True when the tail ends where the head starts (a closed outline).
inline bool is_closed(const Polygon2D *polygon)
{
    return polygon->head != nullptr && polygon->tail->end_x == polygon->head->x &&
           polygon->tail->end_y == polygon->head->y;
}

// Checks that image is a bit image (code 38 otherwise) under function.
bool check_bit_image(const Plx_Image *image, const char *function);
// The scan-line fill of a bit image: mode 0 writes value (0 or nonzero), modes 1 and 2 invert
// the covered bits, other modes fail with code 12. Failures are registered under function.
bool fill_bits(Plx_Image *image, const Polygon2D *polygon, uint32_t value, uint32_t mode, const char *function);

// The feathered fill behind bImageFillPolygonAlpha and its threaded form (host may be null).
bool feather_fill(Plx_Image *alpha, const Plx_Image *inside, const Polygon2D *polygon, Plx_Image *t_image,
                  float (*t_func)(float, float), const ::ThreadHostInterface *host, const char *function);

// v as an index clamped into [lo, hi] (NaN gives lo), safe for any coordinate.
inline int32_t clamp_index(double v, int32_t lo, int32_t hi)
{
    if (!(v > lo)) return lo;
    if (v > hi) return hi;
    return int32_t(v);
}

// ---- feather bands ----
//
// A band has two corners S, E on the outline and their offsets A (of S) and B (of E). Its
// coordinates (s, lambda) place P = (1 - s)(S + lambda (A - S)) + s (E + lambda (B - E)):
// s runs along the outline, lambda across the band (0 on the outline, 1 on the offset line).
struct BandQuad {
    double sx, sy, ex, ey, ax, ay, bx, by;
};
// True when the band is too thin or too short to ramp.
inline bool band_degenerate(const BandQuad &q)
{
    auto d2 = [](double x0, double y0, double x1, double y1) { return (x1 - x0) * (x1 - x0) + (y1 - y0) * (y1 - y0); };
    return d2(q.sx, q.sy, q.ax, q.ay) + d2(q.ex, q.ey, q.bx, q.by) < 0.01 ||
           d2(q.sx, q.sy, q.ex, q.ey) + d2(q.ax, q.ay, q.bx, q.by) < 0.01;
}
// Band coordinates of (px, py): s is the root in [0, 1] (in [0, 1) when half_open) of the
// quadratic that makes P - ((1 - s) S + s E) parallel to the offset direction at s; lambda is
// the ratio of the two along that direction's larger component (when above min_direction).
inline bool band_coordinates(const BandQuad &q, double px, double py, bool half_open, double min_direction,
                             double *s_out, double *lambda)
{
    const double x = px - q.sx, y = py - q.sy;
    const double exx = q.ex - q.sx, eyy = q.ey - q.sy;
    const double a0x = q.ax - q.sx, a0y = q.ay - q.sy;
    const double gx = (q.bx - q.ex) - a0x, gy = (q.by - q.ey) - a0y;
    const double c2 = -(exx * gy - eyy * gx);
    const double c1 = (x * gy - y * gx) - (exx * a0y - eyy * a0x);
    const double c0 = x * a0y - y * a0x;
    auto usable = [half_open](double s) { return s >= 0.0 && (half_open ? s < 1.0 : s <= 1.0); };
    double s;
    if (c2 == 0.0) {
        if (c1 == 0.0) return false;
        s = -c0 / c1;
        if (!usable(s)) return false;
    } else {
        const double disc = c1 * c1 - 4.0 * c2 * c0;
        if (disc < 0.0) return false;
        // The stable pair of roots: no cancellation when c2 is small.
        const double h = -0.5 * (c1 + std::copysign(std::sqrt(disc), c1));
        const double r1 = h / c2, r2 = h != 0.0 ? c0 / h : r1;
        if (usable(r1))
            s = r1;
        else if (usable(r2))
            s = r2;
        else
            return false;
    }
    const double dx = a0x + s * gx, dy = a0y + s * gy;
    const double nx = x - s * exx, ny = y - s * eyy;
    if (std::fabs(dy) >= std::fabs(dx)) {
        if (!(std::fabs(dy) > min_direction)) return false;
        *lambda = ny / dy;
    } else {
        if (!(std::fabs(dx) > min_direction)) return false;
        *lambda = nx / dx;
    }
    *s_out = s;
    return true;
}
// The columns of row centre line y that can lie in the band: the span of the band's convex
// hull on that line, widened by a pixel (image columns, not yet clipped). False when the line
// misses the band.
inline bool band_row_span(const BandQuad &q, double y, double offset_x, int32_t *first, int32_t *last)
{
    const double px[4] = {q.sx, q.ex, q.bx, q.ax}, py[4] = {q.sy, q.ey, q.by, q.ay};
    double lo = HUGE_VAL, hi = -HUGE_VAL;
    for (int i = 0; i < 4; ++i)
        for (int j = i + 1; j < 4; ++j) {
            const double y0 = py[i], y1 = py[j];
            if ((y0 < y && y1 < y) || (y0 > y && y1 > y)) continue;
            double x0 = px[i], x1 = px[j];
            if (y0 != y1) x0 = x1 = px[i] + (y - y0) / (y1 - y0) * (px[j] - px[i]);
            lo = std::fmin(lo, std::fmin(x0, x1));
            hi = std::fmax(hi, std::fmax(x0, x1));
        }
    if (!(lo <= hi) || !std::isfinite(lo) || !std::isfinite(hi)) return false;
    const double a = std::floor(lo - offset_x - 0.5) - 1.0, b = std::ceil(hi - offset_x - 0.5) + 1.0;
    if (b < -1.0 || a > 2.0e9) return false;
    *first = int32_t(std::fmax(a, -1.0));
    *last = int32_t(std::fmin(b, 2.0e9));
    return true;
}
// Visits the pixels of rows [first_row, end_row) of image whose centres can lie in the band
// (rows within its vertical extent, columns of its hull on each row) and calls
// f(row, column, lambda) for those with band coordinates (s in [0, 1]).
template <class F>
void for_band_pixels(const Plx_Image *image, const BandQuad &q, int32_t first_row, int32_t end_row, F &&f)
{
    const double ox = image->x, oy = image->y;
    const double lo = std::fmin(std::fmin(q.sy, q.ey), std::fmin(q.ay, q.by));
    const double hi = std::fmax(std::fmax(q.sy, q.ey), std::fmax(q.ay, q.by));
    const int32_t r0 = clamp_index(std::ceil(lo - oy - 0.5), first_row, end_row);
    const int32_t r1 = clamp_index(std::floor(hi - oy - 0.5) + 1.0, first_row, end_row);
    for (int32_t r = r0; r < r1; ++r) {
        const double py = r + oy + 0.5;
        int32_t c0, c1;
        if (!band_row_span(q, py, ox, &c0, &c1)) continue;
        c0 = std::max(c0, 0);
        c1 = std::min(c1, image->width - 1);
        for (int32_t c = c0; c <= c1; ++c) {
            double s, lambda;
            if (band_coordinates(q, c + ox + 0.5, py, false, 1e-8, &s, &lambda)) f(r, c, lambda);
        }
    }
}
// The four offset points of an edge (start-, end-, start+, end+), as
// bBuildPointsEitherSideOfLine gives them.
void offset_points(const Polygon2DEdge &edge, const Polygon2DEdge *previous, const Polygon2DEdge *next,
                   double out[4][2]);

// ---- scan conversion ----
//
// The hard fill rule: vertices are truncated toward zero in frame coordinates and then
// shifted by the image offset; row y is covered by the edges whose truncated rows satisfy
// lower <= y < upper, and a pixel column c of row y is filled when xL <= c < xR for a pair
// (xL, xR) of consecutive exact crossings of those edges with the line y, taken in order
// along the row (even-odd rule). In pixel-centre terms: pixel (c, y) is filled when the point
// (c + 0.5, y + 0.5) is inside the truncated outline shifted by half a pixel.

struct ScanEdge {
    int32_t x0, y0, x1, y1;  // lower end first (y0 < y1), image coordinates
};

// Collects the non-horizontal edges of the outline (closed implicitly when the tail does
// not end at the head), clipped to +-30000 around the image so that the integer arithmetic
// and the row range stay bounded. Edges with a non-finite end are left out.
bool collect_scan_edges(const Polygon2D *polygon, int32_t offset_x, int32_t offset_y, std::vector<ScanEdge> &edges);

// Spans of one row: sink(row, first, last), inclusive columns already clipped to the image.
// Rows are visited in increasing order between first_row and end_row (clipped to height).
// Returns false (after registering code 5 under "pGET_Init") when out of memory.
template <class Sink>
bool scan_convert(const std::vector<ScanEdge> &edges, int32_t width, int32_t height, int32_t first_row,
                  int32_t end_row, Sink &&sink);

// The hard fill of polygon over an image: sink(row, first, last) for every span, rows in
// increasing order. Failures are registered under function.
template <class Sink>
bool fill_spans(const Plx_Image *image, const Polygon2D *polygon, const char *function, Sink &&sink)
{
    if (polygon->head == nullptr || image->width == 0 || image->height == 0) return true;
    std::vector<ScanEdge> edges;
    if (!collect_scan_edges(polygon, image->x, image->y, edges) ||
        !scan_convert(edges, image->width, image->height, 0, image->height, sink)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    return true;
}

struct ActiveEdge {
    int32_t x;     // ceil of the exact crossing with the current row
    int32_t r;     // x * dy - exact numerator, in [0, dy)
    int32_t dq;    // floor(dx / dy)
    int32_t dr;    // dx - dq * dy, in [0, dy)
    int32_t dy;
    int32_t upper; // the row at which the edge leaves
};

inline int32_t floor_div(int64_t a, int64_t b)
{
    int64_t q = a / b;
    if ((a % b != 0) && ((a < 0) != (b < 0))) --q;
    return int32_t(q);
}

inline ActiveEdge activate(const ScanEdge &e, int32_t row)
{
    ActiveEdge a;
    a.dy = e.y1 - e.y0;
    const int32_t dx = e.x1 - e.x0;
    a.dq = floor_div(dx, a.dy);
    a.dr = dx - a.dq * a.dy;
    // Exact crossing at row: x0 + k dx / dy with k = row - y0; x = its ceiling.
    const int64_t num = int64_t(e.x0) * a.dy + int64_t(row - e.y0) * dx;
    a.x = -floor_div(-num, a.dy);
    a.r = int32_t(int64_t(a.x) * a.dy - num);
    a.upper = e.y1;
    return a;
}

template <class Sink>
bool scan_convert(const std::vector<ScanEdge> &edges, int32_t width, int32_t height, int32_t first_row,
                  int32_t end_row, Sink &&sink)
{
    if (first_row < 0) first_row = 0;
    if (end_row > height) end_row = height;
    if (first_row >= end_row || width <= 0 || edges.empty()) return true;
    const int32_t rows = end_row - first_row;
    // Global edge table: the edges bucketed by the first row they cover within the range.
    std::vector<int32_t> start, order, fill;
    std::vector<ActiveEdge> active;
    try {
        start.assign(std::size_t(rows) + 1, 0);
        fill.resize(std::size_t(rows));
        order.resize(edges.size());
        active.reserve(edges.size());
    } catch (...) {
        register_alloc_failure("pGET_Init", (std::size_t(rows) + edges.size()) * sizeof(int32_t));
        return false;
    }
    for (const ScanEdge &e : edges) {
        if (e.y1 <= first_row || e.y0 >= end_row) continue;
        ++start[std::size_t(std::max(e.y0, first_row) - first_row) + 1];
    }
    for (int32_t i = 0; i < rows; ++i) start[std::size_t(i) + 1] += start[std::size_t(i)];
    std::copy(start.begin(), start.end() - 1, fill.begin());
    for (std::size_t i = 0; i < edges.size(); ++i) {
        const ScanEdge &e = edges[i];
        if (e.y1 <= first_row || e.y0 >= end_row) continue;
        order[std::size_t(fill[std::size_t(std::max(e.y0, first_row) - first_row)]++)] = int32_t(i);
    }
    for (int32_t y = first_row; y < end_row; ++y) {
        // Drop the edges leaving at this row, step the others to it. The carry is taken
        // without a branch: slopes are mixed, so a branch would mispredict half the time.
        std::size_t kept = 0;
        const bool step = y != first_row;
        for (std::size_t i = 0; i < active.size(); ++i) {
            ActiveEdge a = active[i];
            if (a.upper == y) continue;
            if (step) {
                a.x += a.dq;
                a.r -= a.dr;
                const int32_t borrow = a.r >> 31;  // -1 when r went negative
                a.r += borrow & a.dy;
                a.x -= borrow;
            }
            active[kept++] = a;
        }
        active.resize(kept);
        const std::size_t row = std::size_t(y - first_row);
        for (int32_t k = start[row]; k < start[row + 1]; ++k)
            active.push_back(activate(edges[std::size_t(order[std::size_t(k)])], y));
        if (active.empty()) continue;
        // The list stays nearly sorted from row to row: insertion sort is linear then.
        for (std::size_t i = 1; i < active.size(); ++i) {
            const ActiveEdge a = active[i];
            std::size_t j = i;
            while (j > 0 && active[j - 1].x > a.x) {
                active[j] = active[j - 1];
                --j;
            }
            active[j] = a;
        }
        for (std::size_t i = 0; i + 1 < active.size(); i += 2) {
            int32_t first = active[i].x, last = active[i + 1].x - 1;
            if (first < 0) first = 0;
            if (last >= width) last = width - 1;
            if (first <= last) sink(y, first, last);
        }
    }
    return true;
}

}  // namespace plano::pixmap

#endif
