// The geometry of the feather: offset points either side of an edge, and which side of an
// outline is inside a mask.
#include <cmath>

#include "common/internal.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "pixmap/pixmap_spans.hpp"
#include "plano/polygon_fill.h"

namespace plano::pixmap {

namespace {

struct Vec {
    double x, y;
};

// The edge turned a quarter turn, (dy, -dx).
Vec turned(const Polygon2DEdge &e) { return Vec{double(e.end_y) - e.y, double(e.x) - e.end_x}; }

bool normalise(Vec &v)
{
    const double len = std::hypot(v.x, v.y);
    if (len == 0.0) return false;
    v.x /= len, v.y /= len;
    return true;
}

}  // namespace

void offset_points(const Polygon2DEdge &edge, const Polygon2DEdge *previous, const Polygon2DEdge *next,
                   double out[4][2])
{
    const Vec s{edge.x, edge.y}, e{edge.end_x, edge.end_y};
    auto plain = [&] {
        out[0][0] = out[2][0] = s.x, out[0][1] = out[2][1] = s.y;
        out[1][0] = out[3][0] = e.x, out[1][1] = out[3][1] = e.y;
    };
    Vec m = turned(edge);
    if (!normalise(m)) return plain();
    // The direction at one end: this edge's normal averaged with the neighbour's.
    auto direction = [&m](const Polygon2DEdge *neighbour, Vec &n) {
        n = m;
        if (neighbour != nullptr) {
            Vec k = turned(*neighbour);
            normalise(k);
            n.x += k.x, n.y += k.y;
        }
        return normalise(n);
    };
    Vec ns, ne;
    if (!direction(previous, ns) || !direction(next, ne)) return plain();
    const double ws = edge.start_width, we = edge.end_width;
    out[0][0] = s.x - ws * ns.x, out[0][1] = s.y - ws * ns.y;
    out[2][0] = s.x + ws * ns.x, out[2][1] = s.y + ws * ns.y;
    out[1][0] = e.x - we * ne.x, out[1][1] = e.y - we * ne.y;
    out[3][0] = e.x + we * ne.x, out[3][1] = e.y + we * ne.y;
    if (previous == nullptr || next == nullptr) return;
    // At a sharp bend the two offsets of one side can cross: meeting at their midpoint keeps
    // the band from twisting.
    for (int side = 0; side < 4; side += 2) {
        const Segment a{s.x, s.y, out[side][0], out[side][1], 0, 0, 0, 0};
        const Segment b{e.x, e.y, out[side + 1][0], out[side + 1][1], 0, 0, 0, 0};
        if (!edges_cross(a, b, nullptr)) continue;
        const double mx = (out[side][0] + out[side + 1][0]) / 2, my = (out[side][1] + out[side + 1][1]) / 2;
        out[side][0] = out[side + 1][0] = mx;
        out[side][1] = out[side + 1][1] = my;
    }
}

}  // namespace plano::pixmap

extern "C" {

PLANO_API Plx_Bool bBuildPointsEitherSideOfLine(const Polygon2DEdge *edge, const Polygon2DEdge *previous,
                                                const Polygon2DEdge *next, Plx_Vector2_f *start_minus,
                                                Plx_Vector2_f *end_minus, Plx_Vector2_f *start_plus,
                                                Plx_Vector2_f *end_plus)
{
    if (edge == nullptr || start_minus == nullptr || end_minus == nullptr || start_plus == nullptr ||
        end_plus == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null edge or output", 0);
        return 0;
    }
    double out[4][2];
    plano::pixmap::offset_points(*edge, previous, next, out);
    Plx_Vector2_f *dest[4] = {start_minus, end_minus, start_plus, end_plus};
    for (int i = 0; i < 4; ++i) *dest[i] = Plx_Vector2_f{float(out[i][0]), float(out[i][1])};
    return 1;
}

PLANO_API Plx_Bool bDetermineInwardsDirection(const Plx_Image *image, const Plx_Vector2_f *origin,
                                              const Plx_Vector2_f *a, const Plx_Vector2_f *b, uint32_t *result)
{
    if (!plano::pixmap::check_image(image)) return 0;
    if (origin == nullptr || a == nullptr || b == nullptr || result == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null point or result", 0);
        return 0;
    }
    const bool bits = image->type == PLX_TYPE_BIT;
    if ((!bits && image->type != PLX_TYPE_UCHAR) || image->format != PLX_FORMAT_GREY) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "mask must be a bit or unsigned-char grey image", int64_t(image->type));
        return 0;
    }
    double dax = double(a->x) - origin->x, day = double(a->y) - origin->y;
    double dbx = double(b->x) - origin->x, dby = double(b->y) - origin->y;
    const double la = std::hypot(dax, day), lb = std::hypot(dbx, dby);
    if (la == 0.0 || lb == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "zero-length direction", 0);
        return 0;
    }
    dax /= la, day /= la, dbx /= lb, dby /= lb;
    auto set = [image, bits](double x, double y) {
        const double c = std::trunc(x) - image->x, r = std::trunc(y) - image->y;
        if (!(c >= 0 && r >= 0 && c < image->width && r < image->height)) return false;
        const int32_t col = int32_t(c), row = int32_t(r);
        if (bits) return plano::pixmap::bit_at(static_cast<const uint32_t *>(plx_image_row(image, row)), col);
        return static_cast<const uint8_t *>(plx_image_row(image, row))[col] != 0;
    };
    for (int radius = 1; radius <= 5; ++radius) {
        const bool in_a = set(origin->x + radius * dax, origin->y + radius * day);
        const bool in_b = set(origin->x + radius * dbx, origin->y + radius * dby);
        if (in_a != in_b) {
            *result = in_a ? 0u : 1u;
            return 1;
        }
    }
    *result = 2;
    return 1;
}

}  // extern "C"
