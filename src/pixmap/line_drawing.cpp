// Straight lines with thickness, polygon outlines, and an outline saved as an image file.
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>

#include "common/internal.hpp"
#include "pellux/detail/pixel_traits.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "pixmap/pixmap_pixels.hpp"
#include "pixmap/pixmap_spans.hpp"
#include "plano/polygon_fill.h"

namespace plano::pixmap {

namespace {

// Ends further out than this are brought in along the line itself, so that a walk stays
// bounded whatever the coordinates while the line keeps its place and slope.
constexpr double kFar = 100000.0;

struct LinePoint {
    int64_t row, col;
};

// Clips the segment to the square |row|, |col| <= kFar (Liang-Barsky); false when it misses.
bool bring_in(LinePoint &a, LinePoint &b)
{
    const auto far = [](const LinePoint &p) { return std::llabs(p.row) > int64_t(kFar) || std::llabs(p.col) > int64_t(kFar); };
    if (!far(a) && !far(b)) return true;
    const double r0 = double(a.row), c0 = double(a.col), dr = double(b.row) - r0, dc = double(b.col) - c0;
    double t0 = 0.0, t1 = 1.0;
    const double p[4] = {-dr, dr, -dc, dc}, q[4] = {r0 + kFar, kFar - r0, c0 + kFar, kFar - c0};
    for (int i = 0; i < 4; ++i) {
        if (p[i] == 0.0) {
            if (q[i] < 0.0) return false;
            continue;
        }
        const double t = q[i] / p[i];
        if (p[i] < 0.0)
            t0 = std::fmax(t0, t);
        else
            t1 = std::fmin(t1, t);
    }
    if (t0 > t1) return false;
    const LinePoint na{int64_t(std::llround(r0 + t0 * dr)), int64_t(std::llround(c0 + t0 * dc))};
    const LinePoint nb{int64_t(std::llround(r0 + t1 * dr)), int64_t(std::llround(c0 + t1 * dc))};
    a = na, b = nb;
    return true;
}

// Calls plot(row, col) for every pixel of a line inside a width x height image: the
// Bresenham walk along the major axis, repeated for each offset across it. Each pass starts
// where the major coordinate enters the image and stops where it leaves, so the work is
// bounded by the image's size whatever the line's length and thickness.
template <class Plot>
void draw_line(int32_t height, int32_t width, LinePoint a, LinePoint b, uint32_t thickness, Plot &&plot)
{
    auto inside = [height, width](int64_t r, int64_t c) { return r >= 0 && c >= 0 && r < height && c < width; };
    if (a.row == b.row && a.col == b.col) {
        if (inside(a.row, a.col)) plot(int32_t(a.row), int32_t(a.col));
        return;
    }
    if ((a.row < 0 && b.row < 0) || (a.row >= height && b.row >= height) || (a.col < 0 && b.col < 0) ||
        (a.col >= width && b.col >= width))
        return;
    if (!bring_in(a, b)) return;
    const int64_t d_row = b.row - a.row, d_col = b.col - a.col;
    if (d_row == 0 && d_col == 0) {  // brought in to one pixel
        if (inside(a.row, a.col)) plot(int32_t(a.row), int32_t(a.col));
        return;
    }
    const bool rows_major = std::llabs(d_row) >= std::llabs(d_col);
    const int64_t major = rows_major ? std::llabs(d_row) : std::llabs(d_col);
    const int64_t minor = rows_major ? std::llabs(d_col) : std::llabs(d_row);
    const int64_t major_step = (rows_major ? d_row : d_col) > 0 ? 1 : -1;
    const int64_t d_minor = rows_major ? d_col : d_row;
    const int64_t minor_step = d_minor > 0 ? 1 : d_minor < 0 ? -1 : 0;
    const int64_t major0 = rows_major ? a.row : a.col, minor0 = rows_major ? a.col : a.row;
    const int64_t major_size = rows_major ? height : width, minor_size = rows_major ? width : height;
    // Steps k whose major coordinate major0 + k major_step lies in [0, major_size).
    int64_t k0 = major_step > 0 ? -major0 : major0 - major_size + 1;
    int64_t k1 = major_step > 0 ? major_size - 1 - major0 : major0;
    k0 = std::max<int64_t>(k0, 0);
    k1 = std::min(k1, major);
    if (k0 > k1) return;
    // Minor steps taken before step k, as the walk's error term takes them.
    const auto minor_steps = [major, minor](int64_t k) { return (2 * k * minor + major) / (2 * major); };
    const int64_t m0 = minor_steps(k0), m1 = minor_steps(k1);
    const int64_t across_lo = std::min(minor0 + minor_step * m0, minor0 + minor_step * m1);
    const int64_t across_hi = std::max(minor0 + minor_step * m0, minor0 + minor_step * m1);
    // Offsets across the main direction; only those whose pass can reach the image.
    const int64_t lo = std::max(-int64_t((thickness - 1) / 2), -across_hi);
    const int64_t hi = std::min(int64_t(thickness / 2), minor_size - 1 - across_lo);
    for (int64_t offset = lo; offset <= hi; ++offset) {
        int64_t major_at = major0 + major_step * k0, minor_at = minor0 + minor_step * m0 + offset;
        int64_t error = 2 * minor * (k0 + 1) - major - 2 * major * m0;
        for (int64_t k = k0; k <= k1; ++k) {
            if (rows_major ? inside(major_at, minor_at) : inside(minor_at, major_at))
                rows_major ? plot(int32_t(major_at), int32_t(minor_at)) : plot(int32_t(minor_at), int32_t(major_at));
            major_at += major_step;
            if (error < 0) {
                error += 2 * minor;
            } else {
                error -= 2 * (major - minor);
                minor_at += minor_step;
            }
        }
    }
}

// Draws a line given in frame coordinates into any image: bit images take the pixel's bit.
bool draw_into(Plx_Image *image, int64_t y0, int64_t x0, int64_t y1, int64_t x1, const double *pixel,
               uint32_t thickness, const char *function)
{
    const LinePoint a{y0 - image->y, x0 - image->x}, b{y1 - image->y, x1 - image->x};
    if (image->type == PLX_TYPE_BIT) {
        const BitOp op = pixel[0] >= 0.5 ? BitOp::set : BitOp::clear;
        draw_line(image->height, image->width, a, b, thickness, [image, op](int32_t r, int32_t c) {
            apply_bits(static_cast<uint32_t *>(plx_image_row(image, r)), c, c, op);
        });
        return true;
    }
    return with_pixel_type(image, function, [&](auto t) {
        using T = decltype(t);
        const PixelValue<T> value(pixel, plx_image_format_channels(image->format));
        draw_line(image->height, image->width, a, b, thickness, [image, &value](int32_t r, int32_t c) {
            value.write(static_cast<T *>(plx_image_row(image, r)), c);
        });
    });
}

bool check_line_call(const Plx_Image *image, const double *pixel, uint32_t thickness, const char *function)
{
    if (!check_image(image, function)) return false;
    if (pixel == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null pixel", 0);
        return false;
    }
    if (thickness == 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "zero thickness", 0);
        return false;
    }
    return true;
}

// A polygon coordinate as a whole pixel, kept within a range where the line clamp applies.
int64_t pixel_of(float v) { return int64_t(std::fmax(-1e12, std::fmin(1e12, std::floor(double(v))))); }

bool draw_polygon(Plx_Image *image, const Polygon2D *polygon, const double *pixel, uint32_t thickness,
                  const char *function)
{
    for (const Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next) {
        if (!std::isfinite(e->x) || !std::isfinite(e->y) || !std::isfinite(e->end_x) || !std::isfinite(e->end_y))
            continue;
        if (!draw_into(image, pixel_of(e->y), pixel_of(e->x), pixel_of(e->end_y), pixel_of(e->end_x), pixel,
                       thickness, function))
            return false;
    }
    return true;
}

bool write_pgm(const char *file_name, const Plx_Image *image, const char *function)
{
    FILE *file = std::fopen(file_name, "wb");
    if (file == nullptr) {
        PLX_ERR_START_AS(function, PLX_ERROR_OPENING_FILE, file_name, 0);
        return false;
    }
    bool ok = std::fprintf(file, "P5\n%d %d\n255\n", image->width, image->height) > 0;
    for (int32_t r = 0; ok && r < image->height; ++r)
        ok = std::fwrite(plx_image_row(image, r), 1, std::size_t(image->width), file) == std::size_t(image->width);
    ok = std::fclose(file) == 0 && ok;
    if (!ok) PLX_ERR_START_AS(function, PLX_ERROR_WRITING_FILE, file_name, 0);
    return ok;
}

}  // namespace

}  // namespace plano::pixmap

extern "C" {

PLANO_API Plx_Bool bImageDrawLine(Plx_Image *image, int32_t y0, int32_t x0, int32_t y1, int32_t x1,
                                  const double *pixel, uint32_t thickness)
{
    using namespace plano::pixmap;
    if (!check_line_call(image, pixel, thickness, __func__)) return 0;
    return draw_into(image, y0, x0, y1, x1, pixel, thickness, __func__) ? 1 : 0;
}

PLANO_API Plx_Bool bImageDrawPolygon(Plx_Image *image, const Polygon2D *polygon, const double *pixel,
                                     uint32_t thickness)
{
    using namespace plano::pixmap;
    if (!check_polygon(polygon) || !check_line_call(image, pixel, thickness, __func__)) return 0;
    return draw_polygon(image, polygon, pixel, thickness, __func__) ? 1 : 0;
}

PLANO_API Plx_Bool bImageSavePolygon(const char *file_name, uint32_t file_format, const Polygon2D *polygon)
{
    using namespace plano::pixmap;
    if (!check_polygon(polygon)) return 0;
    if (file_name == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null file name", 0);
        return 0;
    }
    if (file_format != POLYGON2D_FILE_PGM) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "unknown file format", int64_t(file_format));
        return 0;
    }
    uint32_t box[4];
    if (!bPolygon2DGetBoundingBox(polygon, box)) {
        PLX_ERR_PASS();
        return 0;
    }
    Plx_Image image{};
    if (plx_image_form_gen_gl_uc(&image, int32_t(box[3]), int32_t(box[2])) == nullptr || !plx_image_fill_zero(&image)) {
        plx_image_free(&image);
        PLX_ERR_PASS();
        return 0;
    }
    image.x = int32_t(box[0]), image.y = int32_t(box[1]);
    const double white = 255.0;
    const bool ok = draw_polygon(&image, polygon, &white, 1, __func__) && write_pgm(file_name, &image, __func__);
    plx_image_free(&image);
    return ok ? 1 : 0;
}

}  // extern "C"
