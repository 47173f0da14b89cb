// Straight lines seen through a camera model: sampled finely and projected with the
// camera's distortion, so that they bend in the picture as the lens bends them.
#include <cmath>
#include <cstdint>

#include "common/internal.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "plano/polygon_fill.h"

namespace {

// Sample spacing in normalised camera coordinates.
constexpr double kStep = 0.1;
// A line needing more samples than this is refused rather than allocated point by point.
constexpr double kMaxSteps = 1.0e7;

bool render(Polygon2D *polygon, const Plx_Camera *camera, const double start[2], const double end[2],
            const char *function)
{
    const double dx = std::fabs(end[0] - start[0]), dy = std::fabs(end[1] - start[1]);
    const double steps = std::fmax(dx, dy) / kStep;
    // The step count is a signed 32-bit number: a span that is not a number, or too long to
    // count, leaves no steps and draws nothing.
    if (std::isnan(dx) || std::isnan(dy) || !(steps < double(INT32_MAX) - 1.0)) return true;
    if (steps > kMaxSteps) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "line needs too many samples", int64_t(steps));
        return false;
    }
    const int64_t n = 1 + int64_t(steps);
    for (int64_t i = 0; i <= n; ++i) {
        const double f = double(i) / double(n);
        const Plx_Vector3 point{(1 - f) * start[0] + f * end[0], (1 - f) * start[1] + f * end[1], 1.0};
        Plx_Vector3 pixel{0, 0, 0};
        if (!plx_camera_project_point(camera, &point, &pixel)) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return false;
        }
        if (pixel.z == 0.0) {
            PLX_ERR_START_AS(function, PLX_ERROR_DIVISION_BY_ZERO, "pixel at infinity", 0);
            return false;
        }
        // (u, v, w) stands for the pixel (zh u / w, zh v / w).
        const double scale = camera->zh / pixel.z;
        if (!bPolygon2DAddWidePointWithT(polygon, float(pixel.y * scale), float(pixel.x * scale), 0.0f, 0.0f)) {
            plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
            return false;
        }
    }
    return true;
}

struct Point3 {
    double x, y, z;
};
Point3 along(const Point3 &a, const Point3 &b, double f)
{
    return Point3{a.x + f * (b.x - a.x), a.y + f * (b.y - a.y), a.z + f * (b.z - a.z)};
}

// A point of the segment from `end` towards `other` that lies in front of the camera and
// inside the widened view, as near to `end` as ten halvings find it.
bool point_in_front(const Point3 &end, const Point3 &other, double wx, double wy, Point3 *out)
{
    auto visible = [wx, wy](const Point3 &p) { return p.z > 0 && std::fabs(p.x) < p.z * wx && std::fabs(p.y) < p.z * wy; };
    if (visible(end)) return *out = end, true;
    // The first visible sample from this end bounds the search.
    constexpr int kHalvings = 10, kSamples = 1 << kHalvings;
    double good = -1.0;
    for (int k = 1; k <= kSamples && good < 0; ++k)
        if (visible(along(end, other, double(k) / kSamples))) good = double(k) / kSamples;
    if (good < 0) {
        PLX_ERR_START_AS("bGetPointInFrontOfCamera", PLX_ERROR_INCOMPATIBLE, "no point in front of the camera", 0);
        return false;
    }
    double bad = good - 1.0 / kSamples;
    for (int k = 0; k < kHalvings; ++k) {
        const double mid = (bad + good) / 2;
        (visible(along(end, other, mid)) ? good : bad) = mid;
    }
    *out = along(end, other, good);
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bPolygonRenderLine(Polygon2D *polygon, const Plx_Camera *camera, const double start[2],
                                      const double end[2])
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    if (camera == nullptr || start == nullptr || end == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null camera or point", 0);
        return 0;
    }
    return render(polygon, camera, start, end, __func__) ? 1 : 0;
}

PLANO_API Plx_Bool bPolygonRenderLineCombined(Polygon2D *polygon, const Plx_Camera *camera, const double start[3],
                                              const double end[3], double extent_x, double extent_y)
{
    if (!plano::pixmap::check_polygon(polygon)) return 0;
    if (camera == nullptr || start == nullptr || end == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null camera or point", 0);
        return 0;
    }
    if (camera->fx == 0.0 || camera->fy == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "zero focal length", 0);
        return 0;
    }
    const double wx = 4.0 * extent_x / std::fabs(camera->fx), wy = 4.0 * extent_y / std::fabs(camera->fy);
    const Point3 a{start[0], start[1], start[2]}, b{end[0], end[1], end[2]};
    Point3 pa, pb;
    if (!point_in_front(a, b, wx, wy, &pa) || !point_in_front(b, a, wx, wy, &pb)) {
        PLX_ERR_PASS();
        return 0;
    }
    // In front of the camera the segment projects to the segment between its ends' rays.
    const double s2[2] = {pa.x / pa.z, pa.y / pa.z}, e2[2] = {pb.x / pb.z, pb.y / pb.z};
    return render(polygon, camera, s2, e2, __func__) ? 1 : 0;
}

}  // extern "C"
