// The homography and illumination states of the tracker's optimiser, and the observations
// that hold a homography state near a given homography (a caller's prior and the motion
// prior of each level).
#include <cmath>
#include <cstring>

#include "pellux/detail/util.hpp"
#include "plano/sumo_states.h"
#include "plano/track_homography.h"
#include "track/track_object_internal.hpp"

namespace {

// Parameters of each model's state; 0 for an unknown model.
using plano::track::model_parameter_count;

// h = x (projective: x - x0, x0 the nine numbers kept in z's user data), Jacobian I.
Plx_Bool homog_identity(SumoStateVector **states, uint32_t n_states, const SumoVector *z, Plx_Vector *h,
                        Plx_Matrix **jacobians, uint32_t n, bool relative, const char *name)
{
    if (states == nullptr || n_states < 1 || states[0] == nullptr || z == nullptr || h == nullptr ||
        (relative && z->user_data == nullptr)) {
        PLX_ERR_START_AS(name, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    const SumoStateVector *s = states[0];
    if (s->x.v.rows != n || h->rows != n) {
        PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "state dimension", s->x.v.rows);
        return PLX_FALSE;
    }
    const auto *x0 = static_cast<const double *>(z->user_data);
    for (uint32_t i = 0; i < n; ++i) h->data[i] = s->x.v.data[i] - (relative ? x0[i] : 0.0);
    Plx_Matrix *J = jacobians ? jacobians[0] : nullptr;
    if (J != nullptr) {
        if (J->rows != n || J->cols != n) {
            PLX_ERR_START_AS(name, PLX_ERROR_INCOMPATIBLE, "Jacobian size", J->rows);
            return PLX_FALSE;
        }
        std::memset(J->data, 0, sizeof(double) * n * n);
        for (uint32_t i = 0; i < n; ++i) J->data[i * n + i] = 1.0;
    }
    return PLX_TRUE;
}

SumoHFunction homog_function(uint32_t model)
{
    switch (model) {
    case TRACK_MODEL_AFFINE: return bAffineHomogH;
    case TRACK_MODEL_PROJ: return bProjHomogH;
    case TRACK_MODEL_TRANSLATE: return bTranslateHomogH;
    case TRACK_MODEL_TRANS_ROT_SCALE: return bTransRotScaleHomogH;
    case TRACK_MODEL_TRANS_SCALE: return bTransScaleHomogH;
    default: return nullptr;
    }
}

void top_rows(const Plx_Matrix33 &H, double s, Plx_Matrix23 *A)
{
    for (int r = 0; r < 2; ++r)
        for (int c = 0; c < 3; ++c) A->m[r][c] = H.m[r][c] / s;
}

// The motion prior's information (size model_parameter_count) into P (row-major, n x n).
bool prior_information(uint32_t model, const Plx_Matrix33 &H, double w, uint32_t height, uint32_t width,
                       double zh, double *P)
{
    if (w == 0.0 || height == 0 || width == 0 || zh == 0.0) {
        PLX_ERR_START_AS("bAddHomogObs", PLX_ERROR_DIVISION_BY_ZERO, "zero prior scale, template size or zh", 0);
        return false;
    }
    const double hh = height, bb = width;
    const double a = (0.5 / w) * (0.5 / w);
    const double tx = (zh / bb / w) * (zh / bb / w);
    const double ty = (zh / hh / w) * (zh / hh / w);
    const uint32_t n = model_parameter_count(model);
    std::memset(P, 0, sizeof(double) * n * n);
    auto diag = [&](std::initializer_list<double> d) {
        uint32_t i = 0;
        for (double v : d) P[i * n + i] = v, ++i;
    };
    switch (model) {
    case TRACK_MODEL_AFFINE: diag({a, a, tx, a, a, ty}); return true;
    case TRACK_MODEL_TRANSLATE: diag({tx, ty}); return true;
    case TRACK_MODEL_TRANS_ROT_SCALE: diag({a, tx, a, ty}); return true;
    case TRACK_MODEL_TRANS_SCALE: diag({a, tx, ty}); return true;
    case TRACK_MODEL_PROJ: break;
    default:
        PLX_ERR_START_AS("bAddHomogObs", PLX_ERROR_ILLEGAL_TYPE, "unknown motion model", model);
        return false;
    }
    if (H.m[2][2] == 0.0) {
        PLX_ERR_START_AS("bAddHomogObs", PLX_ERROR_DIVISION_BY_ZERO, "H22 is 0", 0);
        return false;
    }
    double h[9];
    for (int i = 0; i < 9; ++i) h[i] = H.m[i / 3][i % 3] / H.m[2][2];
    const double span = std::fmin(std::fabs(h[1]) * hh + std::fabs(h[0]) * bb,
                                  std::fabs(h[4]) * hh + std::fabs(h[3]) * bb);
    const double d = (span * 0.25 / w / zh) * (span * 0.25 / w / zh);
    const double D[8] = {a, a, tx, a, a, ty, d, d};
    double e = 0.0, norm2 = 0.0;
    for (int i = 0; i < 8; ++i) e += h[i] * h[i] * D[i];
    for (int i = 0; i < 9; ++i) norm2 += h[i] * h[i];
    // The border makes H itself the null direction: the prior holds the motion, not the scale.
    for (int i = 0; i < 8; ++i) {
        P[i * 9 + i] = D[i];
        P[8 * 9 + i] = P[i * 9 + 8] = -h[i] * D[i];
    }
    P[80] = e;
    for (int i = 0; i < 81; ++i) P[i] *= norm2;
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bMotionInit(Sumo *sumo, SumoStateVector *state, uint32_t model, const Plx_Matrix33 *homography)
{
    if (sumo == nullptr || state == nullptr || homography == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    const Plx_Matrix33 &H = *homography;
    const bool affine_row = H.m[2][0] == 0.0 && H.m[2][1] == 0.0 && H.m[2][2] != 0.0;
    Plx_Matrix23 A;
    Plx_Bool ok;
    switch (model) {
    case TRACK_MODEL_AFFINE:
        if (!affine_row) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "affine homography needs a last row 0 0 h", 0);
            return PLX_FALSE;
        }
        top_rows(H, H.m[2][2], &A);
        ok = bSumoAffHomog33Init(sumo, state, &A);
        break;
    case TRACK_MODEL_PROJ: ok = bSumoHomog33Init(sumo, state, &H); break;
    case TRACK_MODEL_TRANSLATE:
        if (!(H.m[0][0] == 1.0 && H.m[0][1] == 0.0 && H.m[1][0] == 0.0 && H.m[1][1] == 1.0 && H.m[2][0] == 0.0 &&
              H.m[2][1] == 0.0 && H.m[2][2] == 1.0)) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "translation homography needs [1 0 tx; 0 1 ty; 0 0 1]", 0);
            return PLX_FALSE;
        }
        top_rows(H, 1.0, &A);
        ok = bSumoAffHomog33InitTranslation(sumo, state, &A);
        break;
    case TRACK_MODEL_TRANS_ROT_SCALE:
        if (!affine_row || H.m[0][0] != H.m[1][1] || H.m[0][1] != -H.m[1][0]) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "homography is not a rotation and scale", 0);
            return PLX_FALSE;
        }
        top_rows(H, H.m[2][2], &A);
        ok = bSumoAffHomog33InitTransRotScale(sumo, state, &A);
        break;
    case TRACK_MODEL_TRANS_SCALE:
        if (!affine_row || H.m[0][0] != H.m[1][1] || H.m[0][1] != 0.0 || H.m[1][0] != 0.0) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "homography is not a scale", 0);
            return PLX_FALSE;
        }
        top_rows(H, H.m[2][2], &A);
        ok = bSumoAffHomog33InitTransScale(sumo, state, &A);
        break;
    default: PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown motion model", model); return PLX_FALSE;
    }
    if (!ok) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bPixelMatchMatRead(const SumoStateVector *state, Plx_Matrix33 *homography)
{
    if (state == nullptr || homography == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    const double *p = state->x.v.data;
    const uint32_t n = state->x.v.rows;
    double m[9] = {1, 0, 0, 0, 1, 0, 0, 0, 1};
    uint32_t need;
    switch (state->x.type) {
    case TRACK_STATE_PROJ: need = 9; break;
    case TRACK_STATE_AFFINE: need = 6; break;
    case TRACK_STATE_TRANSLATE: need = 2; break;
    case TRACK_STATE_TRANS_SCALE: need = 3; break;
    case TRACK_STATE_TRANS_ROT_SCALE: need = 4; break;
    default: PLX_ERR_START(PLX_ERROR_CALLEE, "not a homography state", state->x.type); return PLX_FALSE;
    }
    if (n != need || p == nullptr) {
        PLX_ERR_START(PLX_ERROR_CALLEE, "state dimension does not fit its type", n);
        return PLX_FALSE;
    }
    switch (state->x.type) {
    case TRACK_STATE_PROJ: std::memcpy(m, p, sizeof m); break;
    case TRACK_STATE_AFFINE: std::memcpy(m, p, sizeof(double) * 6); break;
    case TRACK_STATE_TRANSLATE: m[2] = p[0], m[5] = p[1]; break;
    case TRACK_STATE_TRANS_SCALE: m[0] = m[4] = p[0], m[2] = p[1], m[5] = p[2]; break;
    default: m[0] = m[4] = p[0], m[2] = p[1], m[3] = p[2], m[1] = -p[2], m[5] = p[3]; break;
    }
    for (int i = 0; i < 9; ++i) homography->m[i / 3][i % 3] = m[i];
    return PLX_TRUE;
}

PLANO_API Plx_Bool bIllumInit(Sumo *sumo, SumoStateVector *homography_state, double gain, double offset,
                              Plx_MemoryStack *ms, const ThreadHostInterface *host,
                              SumoStateVector **illumination_state)
{
    if (sumo == nullptr || homography_state == nullptr || illumination_state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    SumoBranch *branch = homography_state->sub_branch;
    if (branch == nullptr) branch = pSumoBranchNewFromState(sumo, homography_state);
    SumoStateVector *s = branch ? pSumoStateVectorNew(sumo, branch, 2, ms, host) : nullptr;
    double values[2] = {gain, offset};
    Plx_Vector x0;
    plx_vec_form_data(&x0, 2, values);
    if (s == nullptr || !bSumoStateVectorInit(sumo, s, &x0)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    *illumination_state = s;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bHomogObs(Sumo *sumo, SumoStateVector *state, uint32_t model, const Plx_Matrix33 *homography,
                             const Plx_SquMatrix *information, Plx_MemoryStack *ms, SumoObs **obs)
{
    if (sumo == nullptr || state == nullptr || homography == nullptr || information == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    const uint32_t n = model_parameter_count(model);
    if (n == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown motion model", model);
        return PLX_FALSE;
    }
    if (information->size != n || state->x.v.rows != n) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "information or state does not fit the model", information->size);
        return PLX_FALSE;
    }
    const Plx_Matrix33 &H = *homography;
    double z[9] = {};
    double *x0 = nullptr;
    if (model == TRACK_MODEL_PROJ) {
        // The state's nine numbers are H at unit Frobenius norm; the observation measures
        // the state's departure from that starting point.
        const double f = plx_mat33_Fnorm_s(&H);
        if (f == 0.0) {
            PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "zero homography", 0);
            return PLX_FALSE;
        }
        x0 = static_cast<double *>(ms ? plx_memory_stack_alloc(ms, sizeof(double) * 9) : PLX_ALLOC(double, 9));
        if (x0 == nullptr) {
            if (ms) PLX_ERR_PASS();
            return PLX_FALSE;
        }
        for (int i = 0; i < 9; ++i) x0[i] = H.m[i / 3][i % 3] / f;
    } else {
        const double s = H.m[2][2];
        if (s == 0.0) {
            PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "H22 is 0", 0);
            return PLX_FALSE;
        }
        const double h00 = H.m[0][0] / s, h01 = H.m[0][1] / s, h02 = H.m[0][2] / s;
        const double h10 = H.m[1][0] / s, h11 = H.m[1][1] / s, h12 = H.m[1][2] / s;
        const double values[4][6] = {{h00, h01, h02, h10, h11, h12},
                                     {h02, h12},
                                     {(h00 + h11) / 2, h02, (h10 - h01) / 2, h12},
                                     {(h00 + h11) / 2, h02, h12}};
        const int row = model == TRACK_MODEL_AFFINE ? 0 : model == TRACK_MODEL_TRANSLATE ? 1
                                                      : model == TRACK_MODEL_TRANS_ROT_SCALE ? 2 : 3;
        std::memcpy(z, values[row], sizeof(double) * n);
    }
    Plx_Vector zv;
    plx_vec_form_data(&zv, n, z);
    SumoObs *o = pSumoObsH(sumo, &zv, information, homog_function(model), ms, &state, 1);
    if (o == nullptr) {
        if (ms == nullptr) std::free(x0);
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (x0 != nullptr) {
        o->z.user_data = x0;
        o->z.user_free = ms ? nullptr : std::free;
    }
    if (obs) *obs = o;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bAddHomogObs(Sumo *sumo, SumoStateVector *state, uint32_t model, const Plx_Matrix33 *homography,
                                double w, uint32_t height, uint32_t width, double zh, Plx_MemoryStack *ms)
{
    if (sumo == nullptr || state == nullptr || homography == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    double P[81];
    if (!prior_information(model, *homography, w, height, width, zh, P)) return PLX_FALSE;
    const uint32_t n = model_parameter_count(model);
    Plx_SquMatrix N;
    plx_squmat_form_data(&N, PLX_SQUMAT_SYMMETRIC, n, P);
    if (!bHomogObs(sumo, state, model, homography, &N, ms, nullptr)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

#define HOMOG_H_ENTRY(name, n, relative)                                                          \
    PLANO_API Plx_Bool name(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,        \
                            uint32_t n_states, const SumoVector *z, Plx_Vector *h,                \
                            Plx_Matrix **jacobians)                                               \
    {                                                                                             \
        (void)sumo;                                                                               \
        (void)workspace;                                                                          \
        return homog_identity(states, n_states, z, h, jacobians, n, relative, #name);             \
    }

HOMOG_H_ENTRY(bAffineHomogH, 6, false)
HOMOG_H_ENTRY(bProjHomogH, 9, true)
HOMOG_H_ENTRY(bTranslateHomogH, 2, false)
HOMOG_H_ENTRY(bTransRotScaleHomogH, 4, false)
HOMOG_H_ENTRY(bTransScaleHomogH, 3, false)

}  // extern "C"
