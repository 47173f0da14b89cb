// 3D rotations between unit quaternions, exponential vectors and matrices.
#include <algorithm>
#include <cmath>

#include "matrix_internal.hpp"
#include "pellux/rotation.h"

namespace {

using plx::null_argument;

bool finite(const Plx_Vector3 &v) { return std::isfinite(v.x) && std::isfinite(v.y) && std::isfinite(v.z); }

// Unit copy of q; false (with code 18 under function) for a zero or non-finite q.
bool unit(const Plx_Quaternion &q, Plx_Quaternion &u, const char *function)
{
    double n = std::sqrt(q.w * q.w + q.x * q.x + q.y * q.y + q.z * q.z);
    if (!(n > 0.0) || !std::isfinite(n))
        return PLX_FAIL(function, PLX_ERROR_DIVISION_BY_ZERO, "quaternion of zero or non-finite length", 0);
    u = {q.w / n, q.x / n, q.y / n, q.z / n};
    return true;
}

Plx_Quaternion from_exponential(const Plx_Vector3 &v)
{
    double theta = std::sqrt(v.x * v.x + v.y * v.y + v.z * v.z);
    // sin(theta / 2) / theta, by its series near 0 where the quotient loses precision.
    double k = theta < 1e-4 ? 0.5 - theta * theta / 48.0 : std::sin(0.5 * theta) / theta;
    return {std::cos(0.5 * theta), k * v.x, k * v.y, k * v.z};
}

void to_matrix(const Plx_Quaternion &q, Plx_Matrix33 &R)
{
    const double w = q.w, x = q.x, y = q.y, z = q.z;
    R = {{{1 - 2 * (y * y + z * z), 2 * (x * y - w * z), 2 * (x * z + w * y)},
          {2 * (x * y + w * z), 1 - 2 * (x * x + z * z), 2 * (y * z - w * x)},
          {2 * (x * z - w * y), 2 * (y * z + w * x), 1 - 2 * (x * x + y * y)}}};
}

Plx_Vector3 to_exponential(Plx_Quaternion q)
{
    if (q.w < 0) q = {-q.w, -q.x, -q.y, -q.z};  // the shorter way round: angle <= pi
    double s = std::sqrt(q.x * q.x + q.y * q.y + q.z * q.z);
    // theta / sin(theta / 2) with theta = 2 atan2(s, w); near 0 it tends to 2 / w.
    double k = s < 1e-8 ? 2.0 / q.w : 2.0 * std::atan2(s, q.w) / s;
    return {k * q.x, k * q.y, k * q.z};
}

// Shepperd's method: take the square root of the largest of the four diagonal combinations,
// so the division below is never by a small number.
bool from_matrix(const Plx_Matrix33 &R, Plx_Quaternion &q, const char *function)
{
    const auto &m = R.m;
    double worst = 0;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) {
            if (!std::isfinite(m[r][c])) return PLX_FAIL(function, PLX_ERROR_ILLEGAL_ARGUMENT, "matrix not finite", 0);
            double d = m[0][r] * m[0][c] + m[1][r] * m[1][c] + m[2][r] * m[2][c] - (r == c ? 1.0 : 0.0);
            worst = std::max(worst, std::fabs(d));
        }
    double det = m[0][0] * (m[1][1] * m[2][2] - m[1][2] * m[2][1]) - m[0][1] * (m[1][0] * m[2][2] - m[1][2] * m[2][0]) +
                 m[0][2] * (m[1][0] * m[2][1] - m[1][1] * m[2][0]);
    if (worst > 1e-6 || det < 0) return PLX_FAIL(function, PLX_ERROR_ILLEGAL_ARGUMENT, "not a rotation matrix", 0);
    double tr = m[0][0] + m[1][1] + m[2][2];
    Plx_Quaternion r;
    if (tr >= m[0][0] && tr >= m[1][1] && tr >= m[2][2]) {
        double s = 2.0 * std::sqrt(1.0 + tr);
        r = {0.25 * s, (m[2][1] - m[1][2]) / s, (m[0][2] - m[2][0]) / s, (m[1][0] - m[0][1]) / s};
    } else if (m[0][0] >= m[1][1] && m[0][0] >= m[2][2]) {
        double s = 2.0 * std::sqrt(1.0 + m[0][0] - m[1][1] - m[2][2]);
        r = {(m[2][1] - m[1][2]) / s, 0.25 * s, (m[0][1] + m[1][0]) / s, (m[0][2] + m[2][0]) / s};
    } else if (m[1][1] >= m[2][2]) {
        double s = 2.0 * std::sqrt(1.0 - m[0][0] + m[1][1] - m[2][2]);
        r = {(m[0][2] - m[2][0]) / s, (m[0][1] + m[1][0]) / s, 0.25 * s, (m[1][2] + m[2][1]) / s};
    } else {
        double s = 2.0 * std::sqrt(1.0 - m[0][0] - m[1][1] + m[2][2]);
        r = {(m[1][0] - m[0][1]) / s, (m[0][2] + m[2][0]) / s, (m[1][2] + m[2][1]) / s, 0.25 * s};
    }
    if (r.w < 0) r = {-r.w, -r.x, -r.y, -r.z};
    return unit(r, q, function);
}

}  // namespace

extern "C" {

PLX_API Plx_Bool plx_rot3D_from_quaternion_q(const Plx_Quaternion *q, Plx_Matrix33 *R)
{
    if (q == nullptr || R == nullptr) return null_argument(__func__);
    Plx_Quaternion u;
    if (!unit(*q, u, __func__)) return PLX_FALSE;
    to_matrix(u, *R);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_rot3D_from_exponential_q(const Plx_Vector3 *omega, Plx_Matrix33 *R)
{
    if (omega == nullptr || R == nullptr) return null_argument(__func__);
    if (!finite(*omega)) return PLX_FAIL(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "vector not finite", 0);
    to_matrix(from_exponential(*omega), *R);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_quaternion_from_rot3D(const Plx_Matrix33 *R, Plx_Quaternion *q)
{
    if (R == nullptr || q == nullptr) return null_argument(__func__);
    return from_matrix(*R, *q, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLX_API Plx_Bool plx_quaternion_from_exponential(const Plx_Vector3 *omega, Plx_Quaternion *q)
{
    if (omega == nullptr || q == nullptr) return null_argument(__func__);
    if (!finite(*omega)) return PLX_FAIL(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "vector not finite", 0);
    *q = from_exponential(*omega);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_exponential_from_quaternion(const Plx_Quaternion *q, Plx_Vector3 *omega)
{
    if (q == nullptr || omega == nullptr) return null_argument(__func__);
    Plx_Quaternion u;
    if (!unit(*q, u, __func__)) return PLX_FALSE;
    *omega = to_exponential(u);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_exponential_from_rot3D(const Plx_Matrix33 *R, Plx_Vector3 *omega)
{
    if (R == nullptr || omega == nullptr) return null_argument(__func__);
    Plx_Quaternion q;
    if (!from_matrix(*R, q, __func__)) return PLX_FALSE;
    *omega = to_exponential(q);
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_quaternion_mult(const Plx_Quaternion *a, const Plx_Quaternion *b, Plx_Quaternion *ab)
{
    if (a == nullptr || b == nullptr || ab == nullptr) return null_argument(__func__);
    Plx_Quaternion r = {a->w * b->w - a->x * b->x - a->y * b->y - a->z * b->z,
                        a->w * b->x + a->x * b->w + a->y * b->z - a->z * b->y,
                        a->w * b->y - a->x * b->z + a->y * b->w + a->z * b->x,
                        a->w * b->z + a->x * b->y - a->y * b->x + a->z * b->w};
    *ab = r;
    return PLX_TRUE;
}

PLX_API Plx_Bool plx_quaternion_normalise(const Plx_Quaternion *q, Plx_Quaternion *u)
{
    if (q == nullptr || u == nullptr) return null_argument(__func__);
    return unit(*q, *u, __func__) ? PLX_TRUE : PLX_FALSE;
}

PLX_API Plx_Bool plx_quaternion_conjugate(const Plx_Quaternion *q, Plx_Quaternion *qc)
{
    if (q == nullptr || qc == nullptr) return null_argument(__func__);
    *qc = {q->w, -q->x, -q->y, -q->z};
    return PLX_TRUE;
}

}  // extern "C"
