// Insertion and overlays.
#include "render.hpp"

#include <algorithm>
#include <cmath>

namespace plano_tool {

namespace {

float *pixel(Plx_Image &image, int32_t r, int32_t c, int channels)
{
    return static_cast<float *>(plx_image_row(&image, r)) + static_cast<ptrdiff_t>(c) * channels;
}

// The quad's bounding box grown by margin pixels, clipped to the image.
Plx_Window quad_window(const Quad &quad, double margin, int32_t width, int32_t height)
{
    double x0 = INFINITY, y0 = INFINITY, x1 = -INFINITY, y1 = -INFINITY;
    for (const Point &p : quad) {
        x0 = std::min(x0, p.x);
        y0 = std::min(y0, p.y);
        x1 = std::max(x1, p.x);
        y1 = std::max(y1, p.y);
    }
    auto clamp = [](double v, int32_t hi) { return static_cast<int32_t>(v >= 0 ? (v <= hi ? v : hi) : 0); };
    int32_t c0 = clamp(std::floor(x0 - margin), width), c1 = clamp(std::ceil(x1 + margin), width);
    int32_t r0 = clamp(std::floor(y0 - margin), height), r1 = clamp(std::ceil(y1 + margin), height);
    return Plx_Window{c0, r0, c1 - c0, r1 - r0};
}

}  // namespace

ImagePtr prepare_insert(const Plx_Image &image)
{
    ImagePtr rgba = convert_image(image, PLX_FORMAT_RGBA, PLX_TYPE_FLOAT);
    for (int32_t r = 0; r < rgba->height; ++r) {
        float *p = static_cast<float *>(plx_image_row(rgba.get(), r));
        for (int32_t c = 0; c < rgba->width; ++c, p += 4) {
            p[0] *= p[3];
            p[1] *= p[3];
            p[2] *= p[3];
        }
    }
    return rgba;
}

ImagePtr insert_onto(const Plx_Image &plate, const Plx_Image &insert, const Quad &quad, double feather,
                     const ThreadHostInterface *host)
{
    ImagePtr work = convert_image(plate, PLX_FORMAT_RGBA, PLX_TYPE_FLOAT);
    // The warp fades the insert's edge over one insert pixel, which a magnified insert spreads
    // over several plate pixels: the work window covers the insert grown by that pixel.
    Plx_Matrix33 to_plate = homography_between(image_corners(insert.width, insert.height), quad);
    Quad reach = quad;
    for (int i = 0; i < 4; ++i) {
        static const double grow[4][2] = {{-1, -1}, {1, -1}, {1, 1}, {-1, 1}};
        const Point c = image_corners(insert.width, insert.height)[i];
        Point p{c.x + grow[i][0], c.y + grow[i][1]};
        double w = to_plate.m[2][0] * p.x + to_plate.m[2][1] * p.y + to_plate.m[2][2];
        Point q = map_through(to_plate, p);
        // Past the horizon the grown corner means nothing: keep the quad's own corner there.
        if (w > 0 && std::isfinite(q.x) && std::isfinite(q.y)) reach[i] = q;
    }
    Plx_Window window = quad_window(reach, 2.0, plate.width, plate.height);
    if (window.width > 0 && window.height > 0) {
        ImagePtr layer = make_image(PLX_FORMAT_RGBA, PLX_TYPE_FLOAT, plate.height, plate.width);
        check(plx_image_fill_zero(layer.get()), "insert layer");
        // Plate positions to insert positions: the insert's corners onto the quad, inverted.
        Plx_Matrix33 H = homography_between(quad, image_corners(insert.width, insert.height));
        ProjectiveWarpParams params;
        vInitProjectiveWarpParams(&params);
        params.high_quality_fill = 1;  // edges fade over one pixel instead of stair-stepping
        params.window_x = window.x;
        params.window_y = window.y;
        params.window_width = window.width;
        params.window_height = window.height;
        check(bImageProjectiveWarpThreaded(layer.get(), nullptr, nullptr, &insert, nullptr, nullptr, &H,
                                           &params, layer.get(), nullptr, host, nullptr, 0),
              "warp");
        for (int32_t r = window.y; r < window.y + window.height; ++r) {
            for (int32_t c = window.x; c < window.x + window.width; ++c) {
                const float *l = pixel(*layer, r, c, 4);
                float *o = pixel(*work, r, c, 4);
                float f = 1.0f;
                if (feather > 0) {
                    double d = distance_inside(quad, Point{c + 0.5, r + 0.5}) / feather;
                    f = static_cast<float>(std::clamp(d, 0.0, 1.0));
                }
                float a = l[3] * f;
                // Where the insert covers the plate fully nothing of the plate is kept, not
                // even a non-finite value (which times zero would spread as NaN).
                if (a >= 1.0f) {
                    for (int k = 0; k < 3; ++k) o[k] = l[k] * f;
                    o[3] = 1.0f;
                    continue;
                }
                for (int k = 0; k < 3; ++k) o[k] = l[k] * f + o[k] * (1.0f - a);
                o[3] = a + o[3] * (1.0f - a);
            }
        }
    }
    return convert_image(*work, plate.format, plate.type);
}

ImagePtr overlay_quad(const Plx_Image &plate, const Quad &quad, std::array<float, 3> colour,
                      double thickness)
{
    bool alpha = plate.format == PLX_FORMAT_GREY_ALPHA || plate.format == PLX_FORMAT_RGBA ||
                 plate.format == PLX_FORMAT_BGRA;
    ImagePtr work = convert_image(plate, PLX_FORMAT_RGBA, PLX_TYPE_FLOAT);
    double half = std::max(0.5, thickness / 2);
    // Each edge, plus a square marking corner 1 so the order can be checked by eye.
    auto paint = [&](auto coverage_at, const Plx_Window &w) {
        for (int32_t r = w.y; r < w.y + w.height; ++r) {
            for (int32_t c = w.x; c < w.x + w.width; ++c) {
                float a = static_cast<float>(std::clamp(coverage_at(Point{c + 0.5, r + 0.5}), 0.0, 1.0));
                if (a <= 0) continue;
                float *o = pixel(*work, r, c, 4);
                for (int k = 0; k < 3; ++k) o[k] = colour[k] * a + o[k] * (1 - a);
                o[3] = a + o[3] * (1 - a);
            }
        }
    };
    for (int i = 0; i < 4; ++i) {
        Point a = quad[i], b = quad[(i + 1) % 4];
        Quad box{a, b, a, b};
        Plx_Window w = quad_window(box, half + 1, plate.width, plate.height);
        double ex = b.x - a.x, ey = b.y - a.y, len2 = ex * ex + ey * ey;
        paint(
            [&](Point p) {
                double t = len2 > 0 ? std::clamp(((p.x - a.x) * ex + (p.y - a.y) * ey) / len2, 0.0, 1.0) : 0.0;
                double d = std::hypot(p.x - (a.x + t * ex), p.y - (a.y + t * ey));
                return half + 0.5 - d;
            },
            w);
    }
    double mark = 2 * half + 2;
    Point c1 = quad[0];
    Quad box{Point{c1.x - mark, c1.y - mark}, Point{c1.x + mark, c1.y - mark},
             Point{c1.x + mark, c1.y + mark}, Point{c1.x - mark, c1.y + mark}};
    paint([&](Point p) { return std::max(std::fabs(p.x - c1.x), std::fabs(p.y - c1.y)) <= mark ? 1.0 : 0.0; },
          quad_window(box, 0, plate.width, plate.height));
    return convert_image(*work, alpha ? PLX_FORMAT_RGBA : PLX_FORMAT_RGB, plate.type);
}

}  // namespace plano_tool
