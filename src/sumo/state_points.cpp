// Point and line states: Euclidean 2D points (257) and 3D points (769, fixed 770), and the
// homogeneous 2D points (258 to 262), 2D lines (513, 514) and 3D points (771 to 776) known up
// to scale. A Euclidean point is the homogeneous point with its last coordinate fixed at 1,
// so the homogeneous functions accept it too.
#include "sumo/state_types.hpp"

using namespace sumo;
using namespace sumo_states;

namespace {

const double kOrigin2D[3] = {0, 0, 1};
const double kOrigin3D[4] = {0, 0, 0, 1};

const Family kPoint2DH = {3,
                          SUMO_TYPE_POINT2DH,
                          SUMO_TYPE_POINT2DH_FIXED,
                          SUMO_TYPE_POINT2DH_MINIMAL0,
                          SUMO_TYPE_POINT2D,
                          bPoint2DHScaleH,
                          kOrigin2D};
const Family kLine2DH = {3, SUMO_TYPE_LINE2DH, SUMO_TYPE_LINE2DH_FIXED, 0, 0, bLine2DHScaleH, nullptr};
const Family kPoint3DH = {4,
                          SUMO_TYPE_POINT3DH,
                          SUMO_TYPE_POINT3DH_FIXED,
                          SUMO_TYPE_POINT3DH_MINIMAL0,
                          SUMO_TYPE_POINT3D,
                          bPoint3DHScaleH,
                          kOrigin3D};

// The homogeneous point of a 3D state; the fixed Euclidean code keeps three coordinates.
bool read_point3dh(const SumoStateVector *s, double *p, const char *function)
{
    if (s->x.type != SUMO_TYPE_POINT3D_FIXED) return family_read(kPoint3DH, s, p, function);
    const auto *stored = static_cast<const double *>(s->x.user_data);
    std::memcpy(p, stored != nullptr ? stored : kOrigin3D, sizeof(double) * 3);
    p[3] = 1.0;
    return true;
}

// The Euclidean point (n coordinates) of a homogeneous one (n + 1).
bool dehomogenise(const double *p, uint32_t n, double *out, const char *function)
{
    if (p[n] == 0.0) {
        fail(function, PLX_ERROR_DIVISION_BY_ZERO, "point at infinity");
        return false;
    }
    for (uint32_t i = 0; i < n; ++i) out[i] = p[i] / p[n];
    return true;
}

// Rows of derivatives over the Euclidean coordinates of a plain (or fixed) point state.
bool fill_euclidean(Plx_Matrix *J, const double *d, uint32_t rows, uint32_t k, int32_t plain, int32_t fixed,
                    double scale, int32_t type, const char *function)
{
    static const uint32_t cols[3] = {0, 1, 2};
    if (type != plain && (fixed == 0 || type != fixed)) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
    return fill_columns(J, d, rows, k, cols, type == plain ? k : 0, scale, function);
}

// The homogeneous 3D fillers also take the fixed Euclidean code (no columns).
bool fill_point3dh(Plx_Matrix *J, const double *d, uint32_t rows, double scale, int32_t type, const char *function)
{
    if (type == SUMO_TYPE_POINT3D_FIXED) return fill_columns(J, d, rows, 4, nullptr, 0, scale, function);
    return family_fill(kPoint3DH, J, d, rows, scale, type, function);
}

}  // namespace

extern "C" {

// ---- 2D points ----

PLANO_API Plx_Bool bSumoPoint2DInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector2 *p)
{
    if (p == nullptr) {
        fail(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return PLX_FALSE;
    }
    const double x[2] = {p->x, p->y};
    return init_state(sumo, state, SUMO_TYPE_POINT2D, x, 2, nullptr, __func__);
}

PLANO_API Plx_Bool bSumoPoint2DReset(SumoStateVector *state, const Plx_Vector2 *p)
{
    if (!check_state(state, p, __func__)) return PLX_FALSE;
    const double v[3] = {p->x, p->y, 1.0};
    return family_reset(kPoint2DH, state, v, __func__);
}

PLANO_API Plx_Bool bSumoPoint2DRead(const SumoStateVector *state, Plx_Vector2 *p)
{
    double v[3], e[2];
    if (!check_state(state, p, __func__) || !family_read(kPoint2DH, state, v, __func__) ||
        !dehomogenise(v, 2, e, __func__))
        return PLX_FALSE;
    p->x = e[0];
    p->y = e[1];
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoPoint2DFillJacobian1(Plx_Matrix *J, const double d[2], double scale, int32_t type)
{
    return fill_euclidean(J, d, 1, 2, SUMO_TYPE_POINT2D, 0, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoPoint2DFillJacobian2(Plx_Matrix *J, const double d[4], double scale, int32_t type)
{
    return fill_euclidean(J, d, 2, 2, SUMO_TYPE_POINT2D, 0, scale, type, __func__);
}

// ---- homogeneous 2D points ----

PLANO_API Plx_Bool bSumoPoint2DHInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p)
{
    return family_init(kPoint2DH, sumo, state, p != nullptr ? &p->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoPoint2DHInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p)
{
    return family_init_fixed(kPoint2DH, sumo, state, p != nullptr ? &p->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoPoint2DHInitMimimal(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p)
{
    return family_init_minimal(kPoint2DH, sumo, state, p != nullptr ? &p->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoPoint2DHReset(SumoStateVector *state, const Plx_Vector3 *p)
{
    return check_state(state, p, __func__) && family_reset(kPoint2DH, state, &p->x, __func__);
}
PLANO_API Plx_Bool bSumoPoint2DHRead(const SumoStateVector *state, Plx_Vector3 *p)
{
    double v[3];
    if (!check_state(state, p, __func__) || !family_read(kPoint2DH, state, v, __func__)) return PLX_FALSE;
    *p = Plx_Vector3{v[0], v[1], v[2]};
    return PLX_TRUE;
}
PLANO_API Plx_Bool bSumoPoint2DHFillJacobian1(Plx_Matrix *J, const double d[3], double scale, int32_t type)
{
    return family_fill(kPoint2DH, J, d, 1, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoPoint2DHFillJacobian2(Plx_Matrix *J, const double d[6], double scale, int32_t type)
{
    return family_fill(kPoint2DH, J, d, 2, scale, type, __func__);
}
PLANO_API Plx_Bool bPoint2DHScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                   uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians)
{
    (void)sumo;
    (void)workspace;
    (void)z;
    return scale_h(states, n_states, h, jacobians, __func__);
}

// ---- homogeneous 2D lines ----

PLANO_API Plx_Bool bSumoLine2DHInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *l)
{
    return family_init(kLine2DH, sumo, state, l != nullptr ? &l->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoLine2DHInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *l)
{
    return family_init_fixed(kLine2DH, sumo, state, l != nullptr ? &l->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoLine2DHReset(SumoStateVector *state, const Plx_Vector3 *l)
{
    return check_state(state, l, __func__) && family_reset(kLine2DH, state, &l->x, __func__);
}
PLANO_API Plx_Bool bSumoLine2DHRead(const SumoStateVector *state, Plx_Vector3 *l)
{
    double v[3];
    if (!check_state(state, l, __func__) || !family_read(kLine2DH, state, v, __func__)) return PLX_FALSE;
    *l = Plx_Vector3{v[0], v[1], v[2]};
    return PLX_TRUE;
}
PLANO_API Plx_Bool bSumoLine2DHFillJacobian1(Plx_Matrix *J, const double d[3], double scale, int32_t type)
{
    return family_fill(kLine2DH, J, d, 1, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoLine2DHFillJacobian2(Plx_Matrix *J, const double d[6], double scale, int32_t type)
{
    return family_fill(kLine2DH, J, d, 2, scale, type, __func__);
}
PLANO_API Plx_Bool bLine2DHScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states, uint32_t n_states,
                                  const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians)
{
    (void)sumo;
    (void)workspace;
    (void)z;
    return scale_h(states, n_states, h, jacobians, __func__);
}

// ---- 3D points ----

PLANO_API Plx_Bool bSumoPoint3DInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p)
{
    if (p == nullptr) {
        fail(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return PLX_FALSE;
    }
    const double x[3] = {p->x, p->y, p->z};
    return init_state(sumo, state, SUMO_TYPE_POINT3D, x, 3, nullptr, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector3 *p)
{
    return init_fixed(sumo, state, SUMO_TYPE_POINT3D_FIXED, p, sizeof(double) * 3, copy_bytes<sizeof(double) * 3>,
                      __func__);
}
PLANO_API Plx_Bool bSumoPoint3DReset(SumoStateVector *state, const Plx_Vector3 *p)
{
    if (!check_state(state, p, __func__)) return PLX_FALSE;
    if (state->x.type == SUMO_TYPE_POINT3D_FIXED) return PLX_TRUE;
    const double v[4] = {p->x, p->y, p->z, 1.0};
    return family_reset(kPoint3DH, state, v, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DRead(const SumoStateVector *state, Plx_Vector3 *p)
{
    double v[4], e[3];
    if (!check_state(state, p, __func__) || !read_point3dh(state, v, __func__) || !dehomogenise(v, 3, e, __func__))
        return PLX_FALSE;
    *p = Plx_Vector3{e[0], e[1], e[2]};
    return PLX_TRUE;
}
PLANO_API Plx_Bool bSumoPoint3DFillJacobian1(Plx_Matrix *J, const double d[3], double scale, int32_t type)
{
    return fill_euclidean(J, d, 1, 3, SUMO_TYPE_POINT3D, SUMO_TYPE_POINT3D_FIXED, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DFillJacobian2(Plx_Matrix *J, const double d[6], double scale, int32_t type)
{
    return fill_euclidean(J, d, 2, 3, SUMO_TYPE_POINT3D, SUMO_TYPE_POINT3D_FIXED, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DFillJacobian3(Plx_Matrix *J, const double d[9], double scale, int32_t type)
{
    return fill_euclidean(J, d, 3, 3, SUMO_TYPE_POINT3D, SUMO_TYPE_POINT3D_FIXED, scale, type, __func__);
}

// ---- homogeneous 3D points ----

PLANO_API Plx_Bool bSumoPoint3DHInit(Sumo *sumo, SumoStateVector *state, const Plx_Vector4 *p)
{
    return family_init(kPoint3DH, sumo, state, p != nullptr ? &p->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DHInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Vector4 *p)
{
    return family_init_fixed(kPoint3DH, sumo, state, p != nullptr ? &p->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DHInitMimimal(Sumo *sumo, SumoStateVector *state, const Plx_Vector4 *p)
{
    return family_init_minimal(kPoint3DH, sumo, state, p != nullptr ? &p->x : nullptr, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DHReset(SumoStateVector *state, const Plx_Vector4 *p)
{
    if (!check_state(state, p, __func__)) return PLX_FALSE;
    if (state->x.type == SUMO_TYPE_POINT3D_FIXED) return PLX_TRUE;
    return family_reset(kPoint3DH, state, &p->x, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DHRead(const SumoStateVector *state, Plx_Vector4 *p)
{
    double v[4];
    if (!check_state(state, p, __func__) || !read_point3dh(state, v, __func__)) return PLX_FALSE;
    *p = Plx_Vector4{v[0], v[1], v[2], v[3]};
    return PLX_TRUE;
}
PLANO_API Plx_Bool bSumoPoint3DHFillJacobian1(Plx_Matrix *J, const double d[4], double scale, int32_t type)
{
    return fill_point3dh(J, d, 1, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DHFillJacobian2(Plx_Matrix *J, const double d[8], double scale, int32_t type)
{
    return fill_point3dh(J, d, 2, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoPoint3DHFillJacobian3(Plx_Matrix *J, const double d[12], double scale, int32_t type)
{
    return fill_point3dh(J, d, 3, scale, type, __func__);
}
PLANO_API Plx_Bool bPoint3DHScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                   uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians)
{
    (void)sumo;
    (void)workspace;
    (void)z;
    return scale_h(states, n_states, h, jacobians, __func__);
}

}  // extern "C"
