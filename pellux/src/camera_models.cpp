// The six operations of the linear, affine and distorted camera types, written once for both
// precisions.
//
// Every distortion model is one closed-form map between undistorted and distorted normalised
// coordinates, with its Jacobian and its derivatives with respect to the coefficients; the
// other direction is a Newton solve of that map. For the radial and x/y models the closed
// form adds distortion; for the inverse radial model it removes it.
#include <cmath>

#include "camera_internal.hpp"
#include "pellux/error.h"

namespace plx {
namespace {

constexpr int kMaxIterations = 100;
constexpr int kMaxCoeffs = PLX_CAMERA_MAX_COEFFS;

const char *message_for(int32_t code)
{
    switch (code) {
    case PLX_ERROR_DIVISION_BY_ZERO: return "zero divisor";
    case PLX_ERROR_OUTSIDE_RANGE: return "point solve did not converge";
    case PLX_ERROR_UNSUPPORTED: return "lines do not stay straight through lens distortion";
    case PLX_ERROR_ILLEGAL_ARGUMENT: return "null argument";
    default: return "";
    }
}

// A point or line operation fails into the caller's slot when one is given (the trace is left
// alone), otherwise as the origin of a new trace.
Plx_Bool fail(int32_t *error_code, const char *name, int32_t code, int line)
{
    if (error_code != nullptr) {
        *error_code = code;
    } else {
        plx_err_flush_trace();
        plx_err_register_fileline(name, code, __FILE__, line, message_for(code), 0);
    }
    return PLX_FALSE;
}
#define PLX_CAMERA_FAIL(name, code) fail(error_code, (name), (code), __LINE__)

// ---- distortion models ----

struct LinearModel {
    static constexpr bool identity = true;
    static constexpr bool affine = false;
    static constexpr int coeffs = 0;
};

// No division by Z: the first two coordinates of a point are its normalised coordinates.
struct AffineModel : LinearModel {
    static constexpr bool affine = true;
};

// (x, y) -> (x d, y d), d = 1 + K1 s + K2 s^2 + K3 s^3, s = x^2 + y^2.
template <int N> struct RadialModel {
    static constexpr bool identity = false;
    static constexpr bool affine = false;
    static constexpr bool add_closed = true;
    static constexpr int coeffs = N;

    template <class T>
    static void map(const T *k, T x, T y, T out[2], T J[2][2], T (*dk)[kMaxCoeffs])
    {
        T s = x * x + y * y;
        T d = 1, dd = 0, power = 1;  // dd = d'(s); power runs through s^i
        for (int i = 0; i < N; ++i) {
            dd += T(i + 1) * k[i] * power;
            power *= s;
            d += k[i] * power;
        }
        out[0] = x * d;
        out[1] = y * d;
        if (J != nullptr) {
            T cross = 2 * x * y * dd;
            J[0][0] = d + 2 * x * x * dd;
            J[0][1] = cross;
            J[1][0] = cross;
            J[1][1] = d + 2 * y * y * dd;
        }
        if (dk != nullptr) {
            T p = s;
            for (int i = 0; i < N; ++i) {
                dk[0][i] = x * p;
                dk[1][i] = y * p;
                p *= s;
            }
        }
    }
};

// The one-coefficient radial map taken the other way round: it removes distortion.
struct InvRadialModel : RadialModel<1> {
    static constexpr bool add_closed = false;
};

// (x, y) -> (x (1 + cxx x^2 + cxy y^2), y (1 + cyx x^2 + cyy y^2)).
struct XYModel {
    static constexpr bool identity = false;
    static constexpr bool affine = false;
    static constexpr bool add_closed = true;
    static constexpr int coeffs = 4;

    template <class T>
    static void map(const T *k, T x, T y, T out[2], T J[2][2], T (*dk)[kMaxCoeffs])
    {
        const T cxx = k[0], cxy = k[1], cyx = k[2], cyy = k[3];
        T x2 = x * x, y2 = y * y;
        out[0] = x * (1 + cxx * x2 + cxy * y2);
        out[1] = y * (1 + cyx * x2 + cyy * y2);
        if (J != nullptr) {
            J[0][0] = 1 + 3 * cxx * x2 + cxy * y2;
            J[0][1] = 2 * cxy * x * y;
            J[1][0] = 2 * cyx * x * y;
            J[1][1] = 1 + cyx * x2 + 3 * cyy * y2;
        }
        if (dk != nullptr) {
            dk[0][0] = x * x2;
            dk[0][1] = x * y2;
            dk[1][2] = y * x2;
            dk[1][3] = y * y2;
        }
    }
};

// ---- solving the closed-form map backwards ----

// Newton iteration for map(x, y) = (tx, ty) from the given start. 0 or an error code.
template <class T, class M>
int32_t newton(const T *k, T tx, T ty, T &x, T &y)
{
    const T tolerance = CameraTraits<T>::tolerance;
    for (int it = 0; it < kMaxIterations; ++it) {
        T f[2], J[2][2];
        M::template map<T>(k, x, y, f, J, nullptr);
        T rx = tx - f[0], ry = ty - f[1];
        T det = J[0][0] * J[1][1] - J[0][1] * J[1][0];
        if (det == 0) return PLX_ERROR_DIVISION_BY_ZERO;
        T dx = (rx * J[1][1] - ry * J[0][1]) / det;
        T dy = (ry * J[0][0] - rx * J[1][0]) / det;
        if (!std::isfinite(dx) || !std::isfinite(dy)) return PLX_ERROR_OUTSIDE_RANGE;
        x += dx;
        y += dy;
        if (std::fabs(dx) + std::fabs(dy) <= tolerance * (1 + std::fabs(x) + std::fabs(y))) {
            // Beyond the radius where a lens folds back on itself the equation has further
            // roots, mirrored or turned about the centre and meaningless. The root sought lies
            // in the region around the centre where the map stays close to the identity:
            // both eigenvalues of its Jacobian positive (positive determinant and trace).
            M::template map<T>(k, x, y, f, J, nullptr);
            det = J[0][0] * J[1][1] - J[0][1] * J[1][0];
            return det > 0 && J[0][0] + J[1][1] > 0 ? 0 : PLX_ERROR_OUTSIDE_RANGE;
        }
    }
    return PLX_ERROR_OUTSIDE_RANGE;
}

// Solves map(x, y) = (tx, ty), starting from the cache's solution when it holds one and from
// the target itself otherwise (or when the cached start fails). The cache keeps the solution
// in normalised coordinates, keyed by the operation's input point.
template <class T, class M>
int32_t invert_map(const T *k, T tx, T ty, T &x, T &y, Plx_PositionState *cache, const double key[3])
{
    int32_t code = -1;
    if (cache != nullptr && cache->valid == 1) {
        x = static_cast<T>(cache->solution[0]);
        y = static_cast<T>(cache->solution[1]);
        code = newton<T, M>(k, tx, ty, x, y);
    }
    if (code != 0) {
        x = tx;
        y = ty;
        code = newton<T, M>(k, tx, ty, x, y);
    }
    if (code == 0 && cache != nullptr) {
        cache->valid = 1;
        for (int i = 0; i < 3; ++i) cache->point[i] = key[i];
        cache->solution[0] = x;
        cache->solution[1] = y;
        cache->solution[2] = 1.0;
    }
    return code;
}

// Adds distortion to normalised (x, y); J and dk (both optional, dk zero on entry) receive
// the derivatives of the distorted point with respect to (x, y) and to the coefficients.
template <class T, class M>
int32_t distort(const T *k, T x, T y, T &xd, T &yd, Plx_PositionState *cache, const double *key,
                T (*J)[2], T (*dk)[kMaxCoeffs])
{
    if constexpr (M::add_closed) {
        T out[2];
        M::template map<T>(k, x, y, out, J, dk);
        xd = out[0];
        yd = out[1];
        return 0;
    } else {
        int32_t code = invert_map<T, M>(k, x, y, xd, yd, cache, key);
        if (code != 0 || (J == nullptr && dk == nullptr)) return code;
        // Implicit derivatives of map(xd, yd; k) = (x, y).
        T out[2], Jm[2][2], dkm[2][kMaxCoeffs] = {};
        M::template map<T>(k, xd, yd, out, Jm, dk != nullptr ? dkm : nullptr);
        T det = Jm[0][0] * Jm[1][1] - Jm[0][1] * Jm[1][0];
        if (det == 0) return PLX_ERROR_DIVISION_BY_ZERO;
        T inv[2][2] = {{Jm[1][1] / det, -Jm[0][1] / det}, {-Jm[1][0] / det, Jm[0][0] / det}};
        if (J != nullptr)
            for (int r = 0; r < 2; ++r)
                for (int c = 0; c < 2; ++c) J[r][c] = inv[r][c];
        if (dk != nullptr)
            for (int r = 0; r < 2; ++r)
                for (int i = 0; i < M::coeffs; ++i) dk[r][i] = -(inv[r][0] * dkm[0][i] + inv[r][1] * dkm[1][i]);
        return 0;
    }
}

template <class T, class M>
int32_t undistort(const T *k, T xd, T yd, T &x, T &y, Plx_PositionState *cache, const double *key)
{
    if constexpr (M::add_closed) {
        return invert_map<T, M>(k, xd, yd, x, y, cache, key);
    } else {
        T out[2];
        M::template map<T>(k, xd, yd, out, nullptr, nullptr);
        x = out[0];
        y = out[1];
        return 0;
    }
}

// ---- pixels and normalised coordinates ----

// Homogeneous pixel (u, v, w) -> normalised (x, y) through the inverse of the linear part.
template <class T>
int32_t normalise(const typename CameraTraits<T>::Camera &c, const typename CameraTraits<T>::Vec3 &p,
                  T &x, T &y)
{
    if (p.z == 0 || c.fx == 0 || c.fy == 0 || c.zh == 0) return PLX_ERROR_DIVISION_BY_ZERO;
    T s = c.zh / p.z;  // exactly 1 for pixels already at the camera's zh
    y = (p.y * s - c.y0) / c.fy;
    x = (p.x * s - c.x0 - c.skew * y) / c.fx;
    return 0;
}

template <class T>
typename CameraTraits<T>::Vec3 to_pixel(const typename CameraTraits<T>::Camera &c, T x, T y)
{
    return {c.fx * x + c.skew * y + c.x0, c.fy * y + c.y0, c.zh};
}

// ---- the six operations ----

template <class T, class M>
Plx_Bool point_project(const typename CameraTraits<T>::Camera *c, const typename CameraTraits<T>::Vec3 *point,
                       typename CameraTraits<T>::Vec3 *pixel, typename CameraTraits<T>::Mat22 *jacobian,
                       typename CameraTraits<T>::Camera *deriv, int32_t *error_code)
{
    using Tr = CameraTraits<T>;
    if (c == nullptr || point == nullptr || pixel == nullptr)
        return PLX_CAMERA_FAIL(Tr::project_name, PLX_ERROR_ILLEGAL_ARGUMENT);
    T x = point->x, y = point->y;
    if constexpr (!M::affine) {
        T Z = point->z;
        if (Z == 0) return PLX_CAMERA_FAIL(Tr::project_name, PLX_ERROR_DIVISION_BY_ZERO);
        if (Z != 1) {
            x /= Z;
            y /= Z;
        }
    }
    T xd = x, yd = y;
    T Jd[2][2] = {{1, 0}, {0, 1}};
    T dk[2][kMaxCoeffs] = {};
    if constexpr (!M::identity) {
        int32_t code = distort<T, M>(c->k, x, y, xd, yd, nullptr, nullptr, jacobian != nullptr ? Jd : nullptr,
                                     deriv != nullptr ? dk : nullptr);
        if (code != 0) return PLX_CAMERA_FAIL(Tr::project_name, code);
    }
    typename Tr::Vec3 out = to_pixel<T>(*c, xd, yd);
    if (jacobian != nullptr) {
        jacobian->m[0][0] = c->fx * Jd[0][0] + c->skew * Jd[1][0];
        jacobian->m[0][1] = c->fx * Jd[0][1] + c->skew * Jd[1][1];
        jacobian->m[1][0] = c->fy * Jd[1][0];
        jacobian->m[1][1] = c->fy * Jd[1][1];
    }
    if (deriv != nullptr) {
        // u = fx xd + skew yd + x0 and v = fy yd + y0, field by field.
        typename Tr::Camera du{}, dv{};
        du.type = dv.type = c->type;
        du.fx = xd;
        du.skew = yd;
        du.x0 = 1;
        dv.fy = yd;
        dv.y0 = 1;
        for (int i = 0; i < M::coeffs; ++i) {
            du.k[i] = c->fx * dk[0][i] + c->skew * dk[1][i];
            dv.k[i] = c->fy * dk[1][i];
        }
        deriv[0] = du;
        deriv[1] = dv;
    }
    *pixel = out;
    return PLX_TRUE;
}

template <class T, class M>
Plx_Bool point_backproject(const typename CameraTraits<T>::Camera *c, const typename CameraTraits<T>::Vec3 *pixel,
                           typename CameraTraits<T>::Vec3 *point, Plx_PositionState *cache, int32_t *error_code)
{
    using Tr = CameraTraits<T>;
    if (c == nullptr || pixel == nullptr || point == nullptr)
        return PLX_CAMERA_FAIL(Tr::backproject_name, PLX_ERROR_ILLEGAL_ARGUMENT);
    T xd, yd;
    int32_t code = normalise<T>(*c, *pixel, xd, yd);
    if (code != 0) return PLX_CAMERA_FAIL(Tr::backproject_name, code);
    T x = xd, y = yd;
    if constexpr (!M::identity) {
        const double key[3] = {pixel->x, pixel->y, pixel->z};
        code = undistort<T, M>(c->k, xd, yd, x, y, cache, key);
        if (code != 0) return PLX_CAMERA_FAIL(Tr::backproject_name, code);
    }
    *point = {x, y, 1};
    return PLX_TRUE;
}

template <class T, class M, bool Add>
Plx_Bool point_distortion(const typename CameraTraits<T>::Camera *c, const typename CameraTraits<T>::Vec3 *in,
                          typename CameraTraits<T>::Vec3 *out, Plx_PositionState *cache, int32_t *error_code)
{
    using Tr = CameraTraits<T>;
    const char *name = Add ? Tr::add_name : Tr::remove_name;
    if (c == nullptr || in == nullptr || out == nullptr) return PLX_CAMERA_FAIL(name, PLX_ERROR_ILLEGAL_ARGUMENT);
    if constexpr (M::identity) {
        // Nothing to move: only bring the pixel to the camera's zh, without the round trip
        // through normalised coordinates.
        if (in->z == 0 || c->zh == 0) return PLX_CAMERA_FAIL(name, PLX_ERROR_DIVISION_BY_ZERO);
        T s = c->zh / in->z;
        *out = {in->x * s, in->y * s, c->zh};
        return PLX_TRUE;
    } else {
        T x, y;
        int32_t code = normalise<T>(*c, *in, x, y);
        if (code != 0) return PLX_CAMERA_FAIL(name, code);
        const double key[3] = {in->x, in->y, in->z};
        T rx, ry;
        if constexpr (Add)
            code = distort<T, M>(c->k, x, y, rx, ry, cache, key, nullptr, nullptr);
        else
            code = undistort<T, M>(c->k, x, y, rx, ry, cache, key);
        if (code != 0) return PLX_CAMERA_FAIL(name, code);
        *out = to_pixel<T>(*c, rx, ry);
        return PLX_TRUE;
    }
}

// A line l of normalised coordinates becomes K^-T l in homogeneous pixels, solved from
// K^T l' = l by forward substitution (K is upper triangular).
template <class T, class M>
Plx_Bool line_project(const typename CameraTraits<T>::Camera *c, const typename CameraTraits<T>::Vec3 *line,
                      typename CameraTraits<T>::Vec3 *out, int32_t *error_code)
{
    using Tr = CameraTraits<T>;
    if (c == nullptr || line == nullptr || out == nullptr)
        return PLX_CAMERA_FAIL(Tr::line_project_name, PLX_ERROR_ILLEGAL_ARGUMENT);
    if (c->fx == 0 || c->fy == 0 || c->zh == 0)
        return PLX_CAMERA_FAIL(Tr::line_project_name, PLX_ERROR_DIVISION_BY_ZERO);
    if constexpr (!M::identity) {
        return PLX_CAMERA_FAIL(Tr::line_project_name, PLX_ERROR_UNSUPPORTED);
    } else {
        T a = line->x / c->fx;
        T b = (line->y - c->skew * a) / c->fy;
        T d = (line->z - c->x0 * a - c->y0 * b) / c->zh;
        *out = {a, b, d};
        return PLX_TRUE;
    }
}

// An image line l' becomes K^T l' in normalised coordinates.
template <class T, class M>
Plx_Bool line_backproject(const typename CameraTraits<T>::Camera *c, const typename CameraTraits<T>::Vec3 *line,
                          typename CameraTraits<T>::Vec3 *out, int32_t *error_code)
{
    using Tr = CameraTraits<T>;
    if (c == nullptr || line == nullptr || out == nullptr)
        return PLX_CAMERA_FAIL(Tr::line_backproject_name, PLX_ERROR_ILLEGAL_ARGUMENT);
    if constexpr (!M::identity) {
        return PLX_CAMERA_FAIL(Tr::line_backproject_name, PLX_ERROR_UNSUPPORTED);
    } else {
        T l0 = line->x, l1 = line->y, l2 = line->z;
        *out = {c->fx * l0, c->skew * l0 + c->fy * l1, c->x0 * l0 + c->y0 * l1 + c->zh * l2};
        return PLX_TRUE;
    }
}

template <class T, class M>
void install(typename CameraTraits<T>::Camera *c)
{
    c->point_project = &point_project<T, M>;
    c->point_backproject = &point_backproject<T, M>;
    c->point_add_distortion = &point_distortion<T, M, true>;
    c->point_remove_distortion = &point_distortion<T, M, false>;
    c->line_project = &line_project<T, M>;
    c->line_backproject = &line_backproject<T, M>;
}

}  // namespace

int camera_coefficient_count(int32_t type)
{
    switch (type) {
    case PLX_LINEAR_CAMERA: return LinearModel::coeffs;
    case PLX_AFFINE_CAMERA: return AffineModel::coeffs;
    case PLX_RADIAL_CAMERA_1: return RadialModel<1>::coeffs;
    case PLX_RADIAL_CAMERA_2: return RadialModel<2>::coeffs;
    case PLX_RADIAL_CAMERA_3: return RadialModel<3>::coeffs;
    case PLX_INV_RADIAL_CAMERA: return InvRadialModel::coeffs;
    case PLX_XY_DISTORTION_CAMERA: return XYModel::coeffs;
    default: return -1;
    }
}

template <class T>
bool install_camera_operations(typename CameraTraits<T>::Camera *camera)
{
    switch (camera->type) {
    case PLX_LINEAR_CAMERA: install<T, LinearModel>(camera); return true;
    case PLX_AFFINE_CAMERA: install<T, AffineModel>(camera); return true;
    case PLX_RADIAL_CAMERA_1: install<T, RadialModel<1>>(camera); return true;
    case PLX_RADIAL_CAMERA_2: install<T, RadialModel<2>>(camera); return true;
    case PLX_RADIAL_CAMERA_3: install<T, RadialModel<3>>(camera); return true;
    case PLX_INV_RADIAL_CAMERA: install<T, InvRadialModel>(camera); return true;
    case PLX_XY_DISTORTION_CAMERA: install<T, XYModel>(camera); return true;
    default: return false;
    }
}

template bool install_camera_operations<double>(Plx_Camera *camera);
template bool install_camera_operations<float>(Plx_Camera_f *camera);

}  // namespace plx
