// Quadrilaterals: parsing, checks, homographies and filling.
#include "geometry.hpp"

#include <algorithm>
#include <cmath>
#include <sstream>
#include <vector>

namespace plano_tool {

Quad parse_quad(const std::string &text)
{
    std::string spaced = text;
    std::replace(spaced.begin(), spaced.end(), ',', ' ');
    std::istringstream in(spaced);
    std::vector<double> v;
    double x;
    while (in >> x) v.push_back(x);
    if (!in.eof() || v.size() != 8 ||
        !std::all_of(v.begin(), v.end(), [](double d) { return std::isfinite(d); }))
        throw ToolError("quad '" + text + "' is not eight numbers x1,y1,x2,y2,x3,y3,x4,y4");
    Quad q;
    for (int i = 0; i < 4; ++i) q[i] = {v[2 * i], v[2 * i + 1]};
    return q;
}

void check_quad(const Quad &quad, int32_t width, int32_t height)
{
    for (int i = 0; i < 4; ++i) {
        const Point &p = quad[i];
        if (!(p.x >= 0 && p.y >= 0 && p.x <= width && p.y <= height)) {
            std::ostringstream s;
            s << "quad corner " << i + 1 << " (" << p.x << ", " << p.y << ") lies outside the " << width
              << "x" << height << " image";
            throw ToolError(s.str());
        }
    }
    // The library's twist test takes corners in the unit square's order, not around the edge.
    if (bCornerPointsTwisted(float(quad[0].x), float(quad[0].y), float(quad[1].x), float(quad[1].y),
                             float(quad[3].x), float(quad[3].y), float(quad[2].x), float(quad[2].y)))
        throw ToolError("quad corners are twisted or not convex (give them around the edge)");
    ImagePtr mask = fill_quad(quad, width, height);
    if (plx_image_bit_count(mask.get()) < 16) throw ToolError("quad covers fewer than 16 pixels");
}

Quad quad_of_mask(const Plx_Image &mask)
{
    Plx_Window w;
    check(plx_image_get_active_subwindow_b(&mask, &w), "mask");
    if (w.width == 0 || w.height == 0) throw ToolError("the mask image has no set pixels");
    double x0 = w.x, y0 = w.y, x1 = w.x + w.width, y1 = w.y + w.height;
    return Quad{Point{x0, y0}, Point{x1, y0}, Point{x1, y1}, Point{x0, y1}};
}

Point map_through(const Plx_Matrix33 &H, Point p)
{
    double x = H.m[0][0] * p.x + H.m[0][1] * p.y + H.m[0][2];
    double y = H.m[1][0] * p.x + H.m[1][1] * p.y + H.m[1][2];
    double w = H.m[2][0] * p.x + H.m[2][1] * p.y + H.m[2][2];
    return {x / w, y / w};
}

Quad map_through(const Plx_Matrix33 &H, const Quad &quad)
{
    Quad out;
    for (int i = 0; i < 4; ++i) out[i] = map_through(H, quad[i]);
    return out;
}

Plx_Matrix33 multiply(const Plx_Matrix33 &A, const Plx_Matrix33 &B)
{
    Plx_Matrix33 AB;
    plx_mat33_rmultm33_s(&A, &B, &AB);
    return AB;
}

Plx_Matrix33 inverse(const Plx_Matrix33 &A)
{
    Plx_Matrix33 inverted;
    check(plx_mat33_invert_s(&A, &inverted), "homography inverse");
    return inverted;
}

Plx_Matrix33 with_unit_h22(Plx_Matrix33 H)
{
    const double h22 = H.m[2][2];
    if (std::fabs(h22) > 1e-12)
        for (auto &row : H.m)
            for (double &v : row) v /= h22;
    return H;
}

Plx_Matrix33 homography_between(const Quad &from, const Quad &to)
{
    // bTex2Scene takes corners in the unit square's order: 1, 2, 4, 3 around the edge.
    static const int order[4] = {0, 1, 3, 2};
    Plx_Vector3 scene[4], texture[4];
    for (int i = 0; i < 4; ++i) {
        scene[i] = {to[order[i]].x, to[order[i]].y, 1.0};
        texture[i] = {from[order[i]].x, from[order[i]].y, 1.0};
    }
    Plx_Matrix33 H;
    check(bTex2Scene(scene, texture, nullptr, nullptr, &H), "corner pin");
    return H;
}

Quad image_corners(double width, double height)
{
    return Quad{Point{0, 0}, Point{width, 0}, Point{width, height}, Point{0, height}};
}

ImagePtr fill_quad(const Quad &quad, int32_t width, int32_t height)
{
    ImagePtr mask = make_image(PLX_FORMAT_GREY, PLX_TYPE_BIT, height, width);
    check(plx_image_fill_zero(mask.get()), "mask");
    double top = height, bottom = 0;
    for (const Point &p : quad) {
        top = std::min(top, p.y);
        bottom = std::max(bottom, p.y);
    }
    // Clamped as doubles first: corners may lie far outside (or be NaN after a bad mapping).
    auto clamp_to = [](double v, double hi) { return v >= 0 ? (v <= hi ? v : hi) : 0.0; };
    int32_t r0 = static_cast<int32_t>(clamp_to(std::floor(top - 0.5), height));
    int32_t r1 = static_cast<int32_t>(clamp_to(std::ceil(bottom), height - 1));
    std::vector<double> xs;
    for (int32_t r = r0; r <= r1; ++r) {
        // Edges crossing the row's centre line, half-open in y so a shared vertex counts once.
        double y = r + 0.5;
        xs.clear();
        for (int i = 0; i < 4; ++i) {
            Point a = quad[i], b = quad[(i + 1) % 4];
            if ((a.y <= y) == (b.y <= y)) continue;
            xs.push_back(a.x + (y - a.y) * (b.x - a.x) / (b.y - a.y));
        }
        std::sort(xs.begin(), xs.end());
        auto *row = static_cast<uint32_t *>(plx_image_row(mask.get(), r));
        for (size_t k = 0; k + 1 < xs.size(); k += 2) {
            // Pixels whose centre c + 0.5 lies in [xs[k], xs[k + 1]).
            double from = std::ceil(xs[k] - 0.5), to = std::ceil(xs[k + 1] - 0.5);
            int32_t c0 = static_cast<int32_t>(clamp_to(from, width));
            int32_t c1 = static_cast<int32_t>(clamp_to(to, width));
            for (int32_t c = c0; c < c1; ++c) row[c >> 5] |= 1u << (c & 31);
        }
    }
    return mask;
}

double distance_inside(const Quad &quad, Point p)
{
    // Signed area fixes the orientation, so "inside" is the same side of every edge.
    double area = 0;
    for (int i = 0; i < 4; ++i) {
        const Point &a = quad[i], &b = quad[(i + 1) % 4];
        area += a.x * b.y - b.x * a.y;
    }
    double orientation = area >= 0 ? 1.0 : -1.0;
    double d = INFINITY;
    for (int i = 0; i < 4; ++i) {
        const Point &a = quad[i], &b = quad[(i + 1) % 4];
        double ex = b.x - a.x, ey = b.y - a.y, len = std::hypot(ex, ey);
        if (len == 0) continue;
        double side = orientation * (ex * (p.y - a.y) - ey * (p.x - a.x)) / len;
        d = std::min(d, side);
    }
    return d;
}

}  // namespace plano_tool
