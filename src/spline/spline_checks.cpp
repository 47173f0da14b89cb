// Argument checks and the random fallback direction shared by the curve entry points.
#include <cmath>
#include <cstdlib>

#include "common/internal.hpp"
#include "spline/spline_internal.hpp"

namespace plano::spline {

bool check_not_null(std::initializer_list<const void *> pointers, const char *function)
{
    for (const void *p : pointers) {
        if (p == nullptr) {
            PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
            return false;
        }
    }
    return true;
}

double edge_scale_single(double x0, double y0, double x1, double y1, double x2, double y2)
{
    auto f = [](double v) { return double(float(v)); };
    return dSplineEdgeScaleFromPoints(f(x0), f(y0), f(x1), f(y1), f(x2), f(y2));
}

void random_unit_direction(double direction[2])
{
    // Only reached when a point has no usable neighbours: any direction will do, and the
    // host's seed keeps runs repeatable.
    auto component = [] { return double(std::rand() % 32768) / 32768.0 * 2.0 - 1.0; };
    double x, y;
    do {
        x = component();
        y = component();
    } while (x == 0.0 && y == 0.0);
    const double length = std::hypot(x, y);
    direction[0] = x / length;
    direction[1] = y / length;
}

}  // namespace plano::spline
