// Helpers shared by the stabilisation sources: argument checks, angle arithmetic and the
// component masks.
#ifndef PLANO_SRC_STABILISE_INTERNAL_HPP
#define PLANO_SRC_STABILISE_INTERNAL_HPP

#include <cmath>
#include <cstdint>
#include <numbers>

#include "common/internal.hpp"
#include "plano/stabilise.h"

namespace plano::stabilise {

// True when every pointer is given; otherwise starts a code-32 failure under caller.
template <class... Ts>
bool given(const char *caller, const Ts *...pointers)
{
    if (((pointers != nullptr) && ...)) return true;
    PLX_ERR_START_AS(caller, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
    return false;
}

// Brings an angle that is at most one turn outside [-pi, pi] back into it.
inline double wrap_angle(double a)
{
    constexpr double pi = std::numbers::pi;
    if (a > pi) return a - 2.0 * pi;
    if (a < -pi) return a + 2.0 * pi;
    return a;
}

// a..b at t along the shorter arc.
inline double interpolate_angle(double a, double b, double t)
{
    double d = wrap_angle(b - a);
    return wrap_angle((a + d) * t + (1.0 - t) * a);
}

// The mask bit of each component index (the flag order of bSmoothHomographies differs from
// the component order: translations come first there).
inline constexpr uint32_t kComponentMask[PLANO_COMPONENT_COUNT] = {
    PLANO_MASK_ROTATION, PLANO_MASK_X_TRANSLATION, PLANO_MASK_Y_TRANSLATION, PLANO_MASK_SCALE,
    PLANO_MASK_SHEAR,    PLANO_MASK_ASPECT,        PLANO_MASK_PERSPECTIVE_X, PLANO_MASK_PERSPECTIVE_Y};
inline constexpr uint32_t kAllComponents = 255;

// How a component moves between two values.
enum class Kind { kLinear, kAngle, kScale };
inline Kind kind_of(int component)
{
    if (component == PLANO_COMPONENT_ROTATION) return Kind::kAngle;
    if (component == PLANO_COMPONENT_SCALE) return Kind::kScale;
    return Kind::kLinear;
}

}  // namespace plano::stabilise

#endif
