// Constraint points and angle constraints of the tracker's optimiser. A constraint point is
// a reference-image point seen by one or more regions: with a given target each region's
// homography must carry it onto the target; otherwise a shared target state is estimated
// that every region's homography must reach. An angle constraint holds the angle between
// three estimated targets.
#include <cfloat>
#include <cmath>
#include <cstring>
#include <numbers>

#include "pellux/detail/util.hpp"
#include "plano/track_homography.h"

namespace {

// The homography state's point q = zh (X/Z, Y/Z), (X, Y, Z) = H (x, y, zh), with dq/dr (2 x 2)
// and, when dqdp is given, dq/d(parameters) (2 x n, n the state's dimension).
bool map_point(const SumoStateVector *state, double x, double y, double zh, double q[2], double dqdr[4],
               double *dqdp, const char *name)
{
    Plx_Matrix33 H;
    if (!bPixelMatchMatRead(state, &H)) {
        plx_err_register_fileline(name, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    const auto &m = H.m;
    const double X = m[0][0] * x + m[0][1] * y + m[0][2] * zh;
    const double Y = m[1][0] * x + m[1][1] * y + m[1][2] * zh;
    const double Z = m[2][0] * x + m[2][1] * y + m[2][2] * zh;
    if (Z == 0.0) {
        PLX_ERR_START_AS(name, PLX_ERROR_DIVISION_BY_ZERO, "point maps to infinity", 0);
        return false;
    }
    const double iz = 1.0 / Z;
    q[0] = zh * X * iz;
    q[1] = zh * Y * iz;
    if (dqdr) {
        dqdr[0] = zh * (m[0][0] * Z - X * m[2][0]) * iz * iz;
        dqdr[1] = zh * (m[0][1] * Z - X * m[2][1]) * iz * iz;
        dqdr[2] = zh * (m[1][0] * Z - Y * m[2][0]) * iz * iz;
        dqdr[3] = zh * (m[1][1] * Z - Y * m[2][1]) * iz * iz;
    }
    if (dqdp) {
        // Derivatives with respect to the nine entries of H, then gathered into the columns
        // of the state's parameters.
        const double a = zh * iz, p[3] = {x, y, zh};
        double d[2][9] = {};
        for (int k = 0; k < 3; ++k) {
            d[0][k] = a * p[k];
            d[1][3 + k] = a * p[k];
            d[0][6 + k] = -q[0] * iz * p[k];
            d[1][6 + k] = -q[1] * iz * p[k];
        }
        const uint32_t n = state->x.v.rows;
        for (int r = 0; r < 2; ++r) {
            double *o = dqdp + r * n;
            const double *e = d[r];
            switch (state->x.type) {
            case TRACK_STATE_PROJ: std::memcpy(o, e, sizeof(double) * 9); break;
            case TRACK_STATE_AFFINE: std::memcpy(o, e, sizeof(double) * 6); break;
            case TRACK_STATE_TRANSLATE: o[0] = e[2], o[1] = e[5]; break;
            case TRACK_STATE_TRANS_SCALE: o[0] = e[0] + e[4], o[1] = e[2], o[2] = e[5]; break;
            default: o[0] = e[0] + e[4], o[1] = e[2], o[2] = e[3] - e[1], o[3] = e[5]; break;
            }
        }
    }
    return true;
}

bool resize_outputs(Plx_Vector *F, Plx_Matrix **jacobians, uint32_t n_states, SumoStateVector **states,
                    Plx_Matrix *Fz, uint32_t z_rows, const char *name)
{
    bool ok = plx_vec_resize(F, 2) != 0;
    if (ok && jacobians)
        for (uint32_t i = 0; i < n_states && ok; ++i)
            if (jacobians[i]) ok = plx_mat_resize(jacobians[i], 2, states[i]->x.v.rows) != 0;
    if (ok && Fz) ok = plx_mat_resize(Fz, 2, z_rows) != 0;
    if (!ok) plx_err_register_fileline(name, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
    return ok;
}

// The covariance of a point given its information (xx, xy, yy) in full-resolution pixels, in
// pixels of a level of scale m: (information m^2)^-1. False when it is not positive definite.
bool point_covariance(const double info[3], double m, double cov[3])
{
    const double det = info[0] * info[2] - info[1] * info[1];
    if (!(info[0] > 0.0) || !(det > 0.0) || !std::isfinite(det)) return false;
    const double s = 1.0 / (det * m * m);
    cov[0] = info[2] * s;
    cov[1] = -info[1] * s;
    cov[2] = info[0] * s;
    return true;
}

// Block-diagonal covariance of up to two points, in the simplest structure that holds it.
void form_covariance(const double *a, const double *b, Plx_SquMatrix *N, double *storage)
{
    const bool iso_a = a[1] == 0.0 && a[0] == a[2];
    const bool iso_b = b == nullptr || (b[1] == 0.0 && b[0] == b[2] && b[0] == a[0]);
    const bool diag = a[1] == 0.0 && (b == nullptr || b[1] == 0.0);
    const uint32_t n = b ? 4 : 2;
    if (iso_a && iso_b) {
        storage[0] = a[0];
        plx_squmat_form_data(N, PLX_SQUMAT_SCALED_IDENTITY, n, storage);
    } else if (diag) {
        storage[0] = a[0], storage[1] = a[2];
        if (b) storage[2] = b[0], storage[3] = b[2];
        plx_squmat_form_data(N, PLX_SQUMAT_DIAGONAL, n, storage);
    } else {
        std::memset(storage, 0, sizeof(double) * n * n);
        const double *blocks[2] = {a, b};
        for (uint32_t k = 0; k < n / 2; ++k) {
            const double *c = blocks[k];
            const uint32_t o = 2 * k;
            storage[o * n + o] = c[0];
            storage[o * n + o + 1] = storage[(o + 1) * n + o] = c[1];
            storage[(o + 1) * n + o + 1] = c[2];
        }
        plx_squmat_form_data(N, PLX_SQUMAT_SYMMETRIC, n, storage);
    }
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bConstraintPointTwoImagesF(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                              uint32_t n_states, const SumoVector *z, Plx_Vector *F,
                                              Plx_Matrix **jacobians, Plx_Matrix *Fz)
{
    (void)sumo;
    (void)workspace;
    if (states == nullptr || n_states < 1 || states[0] == nullptr || z == nullptr || F == nullptr ||
        z->user_data == nullptr || z->v.rows != 4) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument or z not of size 4", 0);
        return PLX_FALSE;
    }
    const double zh = *static_cast<const double *>(z->user_data);
    const double *r = z->v.data;
    const bool want_j = jacobians && jacobians[0];
    double q[2], dqdr[4], dqdp[18];
    if (!map_point(states[0], r[0], r[1], zh, q, dqdr, want_j ? dqdp : nullptr, __func__) ||
        !resize_outputs(F, jacobians, 1, states, Fz, 4, __func__))
        return PLX_FALSE;
    F->data[0] = q[0] - r[2];
    F->data[1] = q[1] - r[3];
    if (want_j) std::memcpy(jacobians[0]->data, dqdp, sizeof(double) * 2 * states[0]->x.v.rows);
    if (Fz) {
        const double fz[8] = {dqdr[0], dqdr[1], -1.0, 0.0, dqdr[2], dqdr[3], 0.0, -1.0};
        std::memcpy(Fz->data, fz, sizeof fz);
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bConstraintPointOneImageF(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                             uint32_t n_states, const SumoVector *z, Plx_Vector *F,
                                             Plx_Matrix **jacobians, Plx_Matrix *Fz)
{
    (void)sumo;
    (void)workspace;
    if (states == nullptr || n_states < 2 || states[0] == nullptr || states[1] == nullptr || z == nullptr ||
        F == nullptr || z->user_data == nullptr || z->v.rows != 2 || states[1]->x.v.rows != 2) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument or sizes not 2", 0);
        return PLX_FALSE;
    }
    const auto *data = static_cast<const TrackConstraintPointData *>(z->user_data);
    const double *r = z->v.data;
    const double *t = states[1]->x.v.data;
    const bool want_j = jacobians && jacobians[0];
    double q[2], dqdr[4], dqdp[18];
    if (!map_point(states[0], r[0], r[1], data->zh, q, dqdr, want_j ? dqdp : nullptr, __func__) ||
        !resize_outputs(F, jacobians, 2, states, Fz, 2, __func__))
        return PLX_FALSE;
    F->data[0] = q[0] + data->search_origin[0] - t[0];
    F->data[1] = q[1] + data->search_origin[1] - t[1];
    if (want_j) std::memcpy(jacobians[0]->data, dqdp, sizeof(double) * 2 * states[0]->x.v.rows);
    if (jacobians && jacobians[1]) {
        const double j[4] = {-1.0, 0.0, 0.0, -1.0};
        std::memcpy(jacobians[1]->data, j, sizeof j);
    }
    if (Fz) std::memcpy(Fz->data, dqdr, sizeof dqdr);
    return PLX_TRUE;
}

PLANO_API Plx_Bool bConstraintPointInit(Sumo *sumo, TrackConstraintPoint *point, uint32_t level)
{
    if (sumo == nullptr || point == nullptr || point->target_state == nullptr || point->no_regions == 0 ||
        point->regions == nullptr || level > 30) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument or no regions", 0);
        return PLX_FALSE;
    }
    const double m = double(1u << level);
    double sum[2] = {0.0, 0.0};
    for (uint32_t i = 0; i < point->no_regions; ++i) {
        const TrackRegion *region = point->regions[i];
        if (region == nullptr || region->state == nullptr) {
            PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "region without a homography state", i);
            return PLX_FALSE;
        }
        double q[2];
        const double x = (point->reference_point[0] - region->template_origin[0]) / m;
        const double y = (point->reference_point[1] - region->template_origin[1]) / m;
        if (!map_point(region->state, x, y, region->camera.zh / m, q, nullptr, nullptr, "bConstraintPointInit")) return PLX_FALSE;
        sum[0] += q[0] + region->search_origin[0] / m;
        sum[1] += q[1] + region->search_origin[1] / m;
    }
    double mean[2] = {sum[0] / point->no_regions, sum[1] / point->no_regions};
    Plx_Vector x0;
    plx_vec_form_data(&x0, 2, mean);
    if (!bSumoStateVectorInit(sumo, point->target_state, &x0)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bBuildConstraintPointObservations(Sumo *sumo, Track *track, TrackConstraintPoint *point,
                                                     uint32_t level, Plx_MemoryStack *ms,
                                                     const ThreadHostInterface *host)
{
    if (sumo == nullptr || track == nullptr || point == nullptr || ms == nullptr || point->regions == nullptr ||
        level > 30) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    const double m = double(1u << level);
    double ref_cov[3], target_cov[3];
    if (!point_covariance(point->reference_information, m, ref_cov) ||
        (point->target_known && !point_covariance(point->target_information, m, target_cov))) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "point information is not positive definite", 0);
        return PLX_FALSE;
    }
    for (uint32_t i = 0; i < point->no_regions; ++i)
        if (point->regions[i] == nullptr || point->regions[i]->state == nullptr) {
            PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "region without a homography state", i);
            return PLX_FALSE;
        }
    // Observations take the covariance of z: the points' information inverted and brought to
    // the level's pixels.
    double storage[16];
    Plx_SquMatrix N;
    form_covariance(ref_cov, point->target_known ? target_cov : nullptr, &N, storage);
    if (!point->target_known) {
        point->target_state = pSumoStateVectorNew(sumo, sumo->root, 2, ms, host);
        if (point->target_state == nullptr) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    for (uint32_t i = 0; i < point->no_regions; ++i) {
        TrackRegion *region = point->regions[i];
        const double zh = region->camera.zh / m;
        double z[4] = {(point->reference_point[0] - region->template_origin[0]) / m,
                       (point->reference_point[1] - region->template_origin[1]) / m,
                       (point->target_point[0] - region->search_origin[0]) / m,
                       (point->target_point[1] - region->search_origin[1]) / m};
        Plx_Vector zv;
        SumoObs *o;
        void *user;
        if (point->target_known) {
            auto *zh_data = static_cast<double *>(plx_memory_stack_alloc(ms, sizeof(double)));
            if (zh_data) *zh_data = zh;
            user = zh_data;
            plx_vec_form_data(&zv, 4, z);
            o = user ? pSumoObsF_va(sumo, &zv, &N, bConstraintPointTwoImagesF, ms, region->state,
                                    static_cast<SumoStateVector *>(nullptr))
                     : nullptr;
        } else {
            auto *data = static_cast<TrackConstraintPointData *>(
                plx_memory_stack_alloc(ms, sizeof(TrackConstraintPointData)));
            if (data) {
                data->zh = zh;
                data->zh_f = float(zh);
                data->search_origin[0] = region->search_origin[0] / m;
                data->search_origin[1] = region->search_origin[1] / m;
            }
            user = data;
            plx_vec_form_data(&zv, 2, z);
            o = user ? pSumoObsF_va(sumo, &zv, &N, bConstraintPointOneImageF, ms, region->state,
                                    point->target_state, static_cast<SumoStateVector *>(nullptr))
                     : nullptr;
        }
        if (o == nullptr) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        o->z.user_data = user;
    }
    if (!point->target_known && !bConstraintPointInit(sumo, point, level)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bCalcConstraintAngle(const double P[2], const double A[2], const double B[2], double threshold,
                                        double *angle, double derivatives[6], int32_t *error_code)
{
    if (P == nullptr || A == nullptr || B == nullptr || angle == nullptr) {
        if (error_code) {
            *error_code = PLX_ERROR_ILLEGAL_ARGUMENT;
        } else {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        }
        return PLX_FALSE;
    }
    const double ux = A[0] - P[0], uy = A[1] - P[1];
    const double vx = B[0] - P[0], vy = B[1] - P[1];
    const double uu = ux * ux + uy * uy, vv = vx * vx + vy * vy;
    if (uu <= threshold || vv <= threshold || uu == 0.0 || vv == 0.0) {
        if (error_code) {
            *error_code = PLX_ERROR_UNDEFINED_ANGLE;
        } else {
            PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "angle of coinciding points", 0);
        }
        return PLX_FALSE;
    }
    *angle = std::atan2(uy * vx - ux * vy, ux * vx + uy * vy);
    if (derivatives) {
        // The angle is the direction of u minus the direction of v.
        const double da[2] = {-uy / uu, ux / uu};
        const double db[2] = {vy / vv, -vx / vv};
        derivatives[0] = -(da[0] + db[0]);
        derivatives[1] = -(da[1] + db[1]);
        derivatives[2] = da[0];
        derivatives[3] = da[1];
        derivatives[4] = db[0];
        derivatives[5] = db[1];
    }
    if (error_code) *error_code = 0;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bAngleConstraintH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                     uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians)
{
    (void)sumo;
    (void)workspace;
    if (states == nullptr || n_states < 3 || z == nullptr || h == nullptr || z->v.rows != 1 || h->rows != 1) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument or z not of size 1", 0);
        return PLX_FALSE;
    }
    for (uint32_t i = 0; i < 3; ++i)
        if (states[i] == nullptr || states[i]->x.v.rows != 2) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "angle states must be 2D points", i);
            return PLX_FALSE;
        }
    const double threshold = z->user_data ? *static_cast<const double *>(z->user_data) : 0.0;
    double angle, d[6];
    if (!bCalcConstraintAngle(states[0]->x.v.data, states[1]->x.v.data, states[2]->x.v.data, threshold, &angle, d,
                              nullptr)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    // Taken within pi of the required angle, so that the residual never jumps by 2 pi.
    h->data[0] = z->v.data[0] + std::remainder(angle - z->v.data[0], 2.0 * std::numbers::pi);
    if (jacobians)
        for (uint32_t i = 0; i < 3; ++i)
            if (jacobians[i]) {
                jacobians[i]->data[0] = d[2 * i];
                jacobians[i]->data[1] = d[2 * i + 1];
            }
    return PLX_TRUE;
}

}  // extern "C"
