// Four-point homographies: exact corner pins through the unit square, the direct linear
// fallback for degenerate quadrilaterals, affine fits, projective centres and twist tests.
#include <cmath>
#include <cstring>

#include "common/internal.hpp"
#include "pellux/camera.h"
#include "pellux/geometry.h"
#include "pellux/matrix.h"
#include "plano/four_point.h"

namespace {

// Corners closer to infinity than this cannot be dehomogenised.
constexpr double kMinCornerW = 1e-6;
// Below this the canonical map's 2x2 system has no usable solution.
constexpr double kMinDenominator = 1e-9;
// Point normalisation of the direct linear fit.
constexpr double kNormaliseMaxScale = 1000.0;
constexpr double kNormaliseTolerance = 1e-15;

// Why an exact map could not be made; nothing is registered, the caller decides.
enum class Exact { kOk, kCornerAtInfinity, kDegenerate };

// Projective map of the unit square's corners (0,0), (1,0), (0,1), (1,1) onto P0..P3.
Exact canonical_map(const Plx_Vector3 P[4], Plx_Matrix33 &C)
{
    double x[4], y[4];
    for (int i = 0; i < 4; ++i) {
        double w = P[i].z;
        if (w == 1.0) {
            x[i] = P[i].x;
            y[i] = P[i].y;
            continue;
        }
        if (!(std::fabs(w) >= kMinCornerW)) return Exact::kCornerAtInfinity;
        x[i] = P[i].x / w;
        y[i] = P[i].y / w;
    }
    double sx = x[0] - x[1] - x[2] + x[3], sy = y[0] - y[1] - y[2] + y[3];
    double dx1 = x[1] - x[3], dy1 = y[1] - y[3];
    double dx2 = x[2] - x[3], dy2 = y[2] - y[3];
    double den = dy1 * dx2 - dy2 * dx1;
    if (!(std::fabs(den) >= kMinDenominator)) return Exact::kDegenerate;
    double h = (dy1 * sx - sy * dx1) / den;
    // Divide by the larger of dx1, dy1: den != 0 guarantees it is not zero.
    double g = std::fabs(dx1) > std::fabs(dy1) ? (sx - h * dx2) / dx1 : (sy - h * dy2) / dy1;
    C = Plx_Matrix33{{{g * x[1] + x[1] - x[0], h * x[2] + x[2] - x[0], x[0]},
                      {g * y[1] + y[1] - y[0], h * y[2] + y[2] - y[0], y[0]},
                      {g, h, 1.0}}};
    return Exact::kOk;
}

// The homography taking quadrilateral A onto B exactly, C_B * C_A^-1. Checking the
// determinant first keeps a degenerate shape, which the caller recovers from, out of the
// error trace.
Exact four_point_transform(const Plx_Vector3 A[4], const Plx_Vector3 B[4], Plx_Matrix33 &H)
{
    Plx_Matrix33 CA, CB, CAinv;
    Exact result = canonical_map(A, CA);
    if (result == Exact::kOk) result = canonical_map(B, CB);
    if (result != Exact::kOk) return result;
    double det = plx_mat33_det_s(&CA);
    if (det == 0.0 || !std::isfinite(det) || !plx_mat33_invert_s(&CA, &CAinv)) return Exact::kDegenerate;
    plx_mat33_rmultm33_s(&CB, &CAinv, &H);
    return Exact::kOk;
}

// Releases a 9x9 accumulator on every path out of the direct linear fit.
struct SquMatrixGuard {
    Plx_SquMatrix *m = nullptr;
    ~SquMatrixGuard() { plx_squmat_free(m); }
};

// Direct linear fit of H with t_i -> p_i for four pairs, both point sets normalised first.
// The caller registers the failure on top of the callee's record.
bool direct_linear_fit(const Plx_Vector3 t[4], const Plx_Vector3 p[4], Plx_Matrix33 &H)
{
    Plx_Vector3 tn[4], pn[4];
    Plx_Matrix33 Tt, Tp, Tp_inv, Hn, HnTt;
    if (!plx_points_normalise(t, 4, kNormaliseMaxScale, kNormaliseTolerance, tn, &Tt) ||
        !plx_points_normalise(p, 4, kNormaliseMaxScale, kNormaliseTolerance, pn, &Tp))
        return false;
    Plx_SquMatrix A;
    SquMatrixGuard guard;
    guard.m = plx_squmat_form(&A, PLX_SQUMAT_SYMMETRIC, 9);
    if (guard.m == nullptr || !plx_squmat_fill_zero(&A)) return false;
    for (int i = 0; i < 4; ++i)
        if (!plx_homog33_increment_p(&A, &tn[i], &pn[i])) return false;
    if (!plx_homog33_solve(&A, 8, &Hn) || !plx_mat33_invert_s(&Tp, &Tp_inv)) return false;
    plx_mat33_rmultm33_s(&Hn, &Tt, &HnTt);
    plx_mat33_rmultm33_s(&Tp_inv, &HnTt, &H);
    return true;
}

double dot(const Plx_Vector3 &a, const Plx_Vector3 &b) { return a.x * b.x + a.y * b.y + a.z * b.z; }

// A camera whose operation is missing has not been built or internalised.
template <class Op>
bool camera_has(Op op, const char *caller)
{
    if (op == nullptr) {
        PLX_ERR_START_AS(caller, PLX_ERROR_NOT_INITIALISED, "camera operations not installed", 0);
        return false;
    }
    return true;
}

bool backproject(const Plx_Camera *camera, const Plx_Vector3 &in, Plx_Vector3 &out, const char *caller)
{
    if (!camera_has(camera->point_backproject, caller)) return false;
    if (!camera->point_backproject(camera, &in, &out, nullptr, nullptr)) {
        plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bTex2Scene(const Plx_Vector3 scene[4], const Plx_Vector3 texture[4],
                              const Plx_Matrix33 *G, const Plx_Camera *camera, Plx_Matrix33 *H)
{
    if (scene == nullptr || texture == nullptr || H == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return 0;
    }
    Plx_Matrix33 Ginv;
    if (G != nullptr && !plx_mat33_invert_s(G, &Ginv)) {
        PLX_ERR_PASS();
        return 0;
    }
    Plx_Vector3 p[4];
    for (int i = 0; i < 4; ++i) {
        p[i] = scene[i];
        if (camera != nullptr && !backproject(camera, scene[i], p[i], __func__)) return 0;
        if (G != nullptr) plx_mat33_multv3_s(&Ginv, &p[i], &p[i]);
    }
    Plx_Matrix33 M;
    Exact exact = four_point_transform(texture, p, M);
    if (exact != Exact::kOk && !direct_linear_fit(texture, p, M)) {
        // The fit dehomogenises too, so a corner at infinity defeats both: name that cause
        // rather than the normalisation's complaint about it.
        if (exact == Exact::kCornerAtInfinity)
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "corner at infinity", 0);
        else
            PLX_ERR_PASS();
        return 0;
    }
    // Keep every texture point in front of the camera: H t_i must point the same way as p_i.
    double w[4], sum = 0.0;
    for (int i = 0; i < 4; ++i) {
        Plx_Vector3 q;
        plx_mat33_multv3_s(&M, &texture[i], &q);
        w[i] = dot(q, p[i]);
        sum += w[i];
    }
    bool negate = sum < 0.0;
    for (double wi : w) {
        if (negate ? !(wi < 0.0) : !(wi > 0.0)) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "corners on both sides of the camera", 0);
            return 0;
        }
    }
    if (negate) plx_mat33_scale_s(&M, -1.0, &M);
    *H = M;
    return 1;
}

PLANO_API Plx_Bool bTex2SceneAffine(const Plx_Vector3 *scene, const Plx_Vector3 *texture,
                                    uint32_t n, const Plx_Camera *camera, Plx_Matrix33 *H)
{
    if (scene == nullptr || texture == nullptr || H == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return 0;
    }
    plx::HeapPtr<Plx_Vector3> p(PLX_ALLOC(Plx_Vector3, n));
    if (p == nullptr) return 0;
    for (uint32_t i = 0; i < n; ++i) {
        p.get()[i] = scene[i];
        if (camera != nullptr && !backproject(camera, scene[i], p.get()[i], __func__)) return 0;
    }
    Plx_PseudoInverseSolver solver;
    if (plx_psinv_form(&solver, 6) == nullptr) {
        PLX_ERR_PASS();
        return 0;
    }
    bool ok = true;
    for (uint32_t i = 0; ok && i < n; ++i) ok = plx_affine33_increment_p(&solver, &texture[i], &p.get()[i]);
    Plx_Matrix23 A;
    ok = ok && plx_affine33_solve(&solver, 2 * n, &A);
    plx_psinv_free(&solver);
    if (!ok) {
        PLX_ERR_PASS();
        return 0;
    }
    // The fit maps dehomogenised points, so the matrix keeps w: H (u, v, w) = (A (u, v, w), w).
    *H = Plx_Matrix33{{{A.m[0][0], A.m[0][1], A.m[0][2]},
                       {A.m[1][0], A.m[1][1], A.m[1][2]},
                       {0.0, 0.0, 1.0}}};
    return 1;
}

PLANO_API Plx_Bool bComputeProjectiveCentre(const Plx_Vector3 scene[4], const Plx_Camera *camera,
                                            Plx_Vector3 *centre)
{
    if (scene == nullptr || centre == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return 0;
    }
    static const Plx_Vector3 kSquare[4] = {{-0.5, -0.5, 1.0}, {0.5, -0.5, 1.0}, {-0.5, 0.5, 1.0}, {0.5, 0.5, 1.0}};
    Plx_Matrix33 H;
    if (!bTex2Scene(scene, kSquare, nullptr, camera, &H)) {
        PLX_ERR_PASS();
        return 0;
    }
    Plx_Vector3 c{H.m[0][2], H.m[1][2], H.m[2][2]};
    if (camera != nullptr) {
        Plx_Vector3 pixel;
        if (!camera_has(camera->point_project, __func__)) return 0;
        if (!camera->point_project(camera, &c, &pixel, nullptr, nullptr, nullptr)) {
            PLX_ERR_PASS();
            return 0;
        }
        c = pixel;
    }
    *centre = c;
    return 1;
}

PLANO_API Plx_Bool bCornerPointsTwisted(float x0, float y0, float x1, float y1, float x2, float y2,
                                        float x3, float y3)
{
    // Walk the boundary 0 -> 2 -> 3 -> 1 and require every turn to have the first one's sign.
    const double px[4] = {x0, x2, x3, x1}, py[4] = {y0, y2, y3, y1};
    constexpr double kMinTurn = 0.0001;
    bool positive = false;
    for (int i = 0; i < 4; ++i) {
        int a = i, b = (i + 1) % 4, c = (i + 2) % 4;
        double t = (px[c] - px[b]) * (py[b] - py[a]) - (py[c] - py[b]) * (px[b] - px[a]);
        if (i == 0) {
            positive = t > 0.0;
            continue;
        }
        if (positive ? t <= kMinTurn : t >= -kMinTurn) return 1;
    }
    return 0;
}

}  // extern "C"
