// Moving a region's homography between calibrated camera coordinates, whole-frame pixels and
// window pixels, with its information matrix carried along, and bringing a homography back
// to the shape of its motion model.
//
// Every change here is H_new = A H_old B with A and B fixed 3x3 matrices whose last row is
// (0, 0, 1) (normalised camera matrices, translations). The model's parameters p are linear
// in H, so the information on the new parameters is J^T I J with J = d p_old / d p_new, the
// parameters of A^-1 dH B^-1 for each unit change dH of one new parameter.
#include <cmath>
#include <cstring>

#include "common/internal.hpp"
#include "track/track_object_internal.hpp"

namespace {

using M3 = Plx_Matrix33;

M3 mul(const M3 &a, const M3 &b)
{
    M3 c;
    plx_mat33_rmultm33_s(&a, &b, &c);
    return c;
}

M3 translation(double tx, double ty)
{
    M3 t;
    plx_mat33_ident_s(&t);
    t.m[0][2] = tx;
    t.m[1][2] = ty;
    return t;
}

// The unit change of parameter j of a model as a change of the 3x3 matrix.
M3 parameter_direction(uint32_t model, uint32_t j)
{
    M3 d{};
    switch (model) {
    case TRACK_MODEL_AFFINE: d.m[j / 3][j % 3] = 1.0; break;
    case TRACK_MODEL_PROJ: d.m[j / 3][j % 3] = 1.0; break;
    case TRACK_MODEL_TRANSLATE: d.m[j][2] = 1.0; break;
    case TRACK_MODEL_TRANS_ROT_SCALE:  // (a, tx, b, ty) of [a -b tx; b a ty]
        if (j == 0) d.m[0][0] = d.m[1][1] = 1.0;
        if (j == 1) d.m[0][2] = 1.0;
        if (j == 2) d.m[0][1] = -1.0, d.m[1][0] = 1.0;
        if (j == 3) d.m[1][2] = 1.0;
        break;
    case TRACK_MODEL_TRANS_SCALE:  // (s, tx, ty) of [s 0 tx; 0 s ty]
        if (j == 0) d.m[0][0] = d.m[1][1] = 1.0;
        if (j == 1) d.m[0][2] = 1.0;
        if (j == 2) d.m[1][2] = 1.0;
        break;
    default: break;
    }
    return d;
}

// The model's parameters of a 3x3 matrix; the reduced models take the nearest member of
// their family (mean diagonal, half the difference of the off-diagonal pair).
void parameters_of(uint32_t model, const M3 &h, double *p)
{
    switch (model) {
    case TRACK_MODEL_AFFINE:
        for (int i = 0; i < 6; ++i) p[i] = h.m[i / 3][i % 3];
        break;
    case TRACK_MODEL_PROJ: std::memcpy(p, &h.m[0][0], sizeof(double) * 9); break;
    case TRACK_MODEL_TRANSLATE:
        p[0] = h.m[0][2];
        p[1] = h.m[1][2];
        break;
    case TRACK_MODEL_TRANS_ROT_SCALE:
        p[0] = 0.5 * (h.m[0][0] + h.m[1][1]);
        p[1] = h.m[0][2];
        p[2] = 0.5 * (h.m[1][0] - h.m[0][1]);
        p[3] = h.m[1][2];
        break;
    case TRACK_MODEL_TRANS_SCALE:
        p[0] = 0.5 * (h.m[0][0] + h.m[1][1]);
        p[1] = h.m[0][2];
        p[2] = h.m[1][2];
        break;
    default: break;
    }
}

// Checks an information matrix against the model; registers under function.
bool check_information(const Plx_SquMatrix *information, uint32_t n, const char *function)
{
    if (information == nullptr) return true;
    if (information->size != n) {
        PLX_ERR_START_AS(function, PLX_ERROR_INCOMPATIBLE, "information matrix does not fit the motion model",
                         information->size);
        return false;
    }
    if (information->type < PLX_SQUMAT_SYMMETRIC || information->type > PLX_SQUMAT_GENERIC) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_TYPE, "unknown matrix structure", information->type);
        return false;
    }
    return true;
}

// information <- J^T information J for the change whose inverse is H_old = a_inv H_new b_inv.
// A diagonal or scaled-identity record becomes symmetric, since the result is full in general.
bool transform_information(Plx_SquMatrix *information, uint32_t model, const M3 &a_inv, const M3 &b_inv,
                           const char *function)
{
    if (information == nullptr) return true;
    const uint32_t n = plano::track::model_parameter_count(model);
    double J[9][9], I[9][9], R[81];
    for (uint32_t j = 0; j < n; ++j) {
        double column[9];
        parameters_of(model, mul(mul(a_inv, parameter_direction(model, j)), b_inv), column);
        for (uint32_t i = 0; i < n; ++i) J[i][j] = column[i];
    }
    for (uint32_t i = 0; i < n; ++i)
        for (uint32_t j = 0; j < n; ++j) I[i][j] = plx_squmat_get(information, i, j);
    double IJ[9][9];
    for (uint32_t i = 0; i < n; ++i)
        for (uint32_t j = 0; j < n; ++j) {
            double s = 0.0;
            for (uint32_t k = 0; k < n; ++k) s += I[i][k] * J[k][j];
            IJ[i][j] = s;
        }
    for (uint32_t i = 0; i < n; ++i)
        for (uint32_t j = 0; j <= i; ++j) {
            double s = 0.0;
            for (uint32_t k = 0; k < n; ++k) s += J[k][i] * IJ[k][j];
            R[i * n + j] = R[j * n + i] = s;
        }
    if (information->type != PLX_SQUMAT_SYMMETRIC && information->type != PLX_SQUMAT_GENERIC &&
        !plx_squmat_resize(information, PLX_SQUMAT_SYMMETRIC, n)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    if (!plx_squmat_fill(information, R)) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    return true;
}

// Camera matrix divided by its homogeneous coordinate, so that its last row is (0, 0, 1).
M3 normalised_camera_matrix(const Plx_Camera *camera)
{
    M3 k;
    plx_camera_fill_matrix_s(camera, &k);
    if (camera->zh != 0.0) plx_mat33_scale_s(&k, 1.0 / camera->zh, &k);
    return k;
}

// A region's motion being converted: its model, homography and a symmetric copy of its
// information matrix (zero when it has none).
struct RegionMotion {
    uint32_t model, n;
    M3 h;
    double storage[81];
    Plx_SquMatrix info{};

    explicit RegionMotion(const TrackRegion *region)
        : model(region->settings.motion_model), n(plano::track::model_parameter_count(model)), h(region->homography)
    {
        plx_squmat_form_data(&info, PLX_SQUMAT_SYMMETRIC, n, storage);
        for (uint32_t i = 0; i < n; ++i)
            for (uint32_t j = 0; j < n; ++j)
                storage[i * n + j] = region->information != nullptr ? plx_squmat_get(region->information, i, j) : 0.0;
    }
    // The parameters shrink by f: their information grows by f^2.
    void scale_information(double f)
    {
        for (uint32_t i = 0; i < n * n; ++i) storage[i] *= f * f;
    }
};

// Stores the converted homography and information into the region.
bool store_region(TrackRegion *region, const M3 &h, const Plx_SquMatrix &information, bool to_window)
{
    if (region->information != nullptr) {
        if (region->information->type != PLX_SQUMAT_SYMMETRIC && region->information->type != PLX_SQUMAT_GENERIC &&
            !plx_squmat_resize(region->information, PLX_SQUMAT_SYMMETRIC, information.size))
            return false;
        if (!plx_squmat_fill(region->information, information.data)) return false;
    }
    region->homography = h;
    region->in_window_pixels = to_window ? 1u : 0u;
    return true;
}

}  // namespace

namespace plano::track {

bool region_to_window_pixels(const Track *track, TrackRegion *region, const char *function)
{
    (void)function;
    RegionMotion m(region);
    double scale = 1.0;
    // The homography arrives with any scale; its information is for that scale.
    if (!bCorrectHomography(m.model, &m.h, &scale)) return false;
    m.scale_information(scale);
    if (!bTrackApplyCalibToHomography(&m.h, &m.info, m.model, &track->current_camera, region, 1) ||
        !bTrackApplyOffsetsToHomography(&m.h, &m.info, m.model, region->search_origin, track->current_camera.zh,
                                        region->template_origin, region->camera.zh, 1) ||
        !bCorrectHomography(m.model, &m.h, nullptr))
        return false;
    return store_region(region, m.h, m.info, true);
}

bool region_to_calibrated(const Track *track, TrackRegion *region, const char *function)
{
    RegionMotion m(region);
    if (!bTrackApplyOffsetsToHomography(&m.h, &m.info, m.model, region->search_origin, track->current_camera.zh,
                                        region->template_origin, region->camera.zh, 0) ||
        !bTrackApplyCalibToHomography(&m.h, &m.info, m.model, &track->current_camera, region, 0))
        return false;
    if (m.model == TRACK_MODEL_PROJ) {
        // Unit Frobenius norm.
        const double f = plx_mat33_Fnorm_s(&m.h);
        if (f == 0.0 || !std::isfinite(f)) {
            PLX_ERR_START_AS(function, PLX_ERROR_DIVISION_BY_ZERO, "homography is zero", 0);
            return false;
        }
        plx_mat33_scale_s(&m.h, 1.0 / f, &m.h);
        m.scale_information(f);
    }
    if (!bCorrectHomography(m.model, &m.h, nullptr)) return false;
    return store_region(region, m.h, m.info, false);
}

}  // namespace plano::track

extern "C" {

PLANO_API Plx_Bool bCorrectHomography(uint32_t model, Plx_Matrix33 *homography, double *scale)
{
    if (homography == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null homography", 0);
        return 0;
    }
    if (plano::track::model_parameter_count(model) == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown motion model", model);
        return 0;
    }
    // A projective homography is kept as it is: any H22, zero included, is a valid one.
    if (model == TRACK_MODEL_PROJ) {
        if (scale != nullptr) *scale = 1.0;
        return 1;
    }
    M3 &H = *homography;
    const double h = H.m[2][2];
    if (h == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "H22 is 0", 0);
        return 0;
    }
    const double tx = H.m[0][2] / h, ty = H.m[1][2] / h;
    M3 out;
    switch (model) {
    case TRACK_MODEL_AFFINE:
        out = M3{{{H.m[0][0] / h, H.m[0][1] / h, tx}, {H.m[1][0] / h, H.m[1][1] / h, ty}, {0, 0, 1}}};
        break;
    case TRACK_MODEL_TRANSLATE: out = translation(tx, ty); break;
    case TRACK_MODEL_TRANS_ROT_SCALE: {
        const double a = (H.m[0][0] + H.m[1][1]) / (2 * h), b = (H.m[1][0] - H.m[0][1]) / (2 * h);
        out = M3{{{a, -b, tx}, {b, a, ty}, {0, 0, 1}}};
        break;
    }
    default: {  // translation-scale
        const double s = (H.m[0][0] + H.m[1][1]) / (2 * h);
        out = M3{{{s, 0, tx}, {0, s, ty}, {0, 0, 1}}};
        break;
    }
    }
    H = out;
    if (scale != nullptr) *scale = h;
    return 1;
}

PLANO_API Plx_Bool bTrackApplyCalibToHomography(Plx_Matrix33 *homography, Plx_SquMatrix *information,
                                                uint32_t model, const Plx_Camera *camera_a,
                                                const TrackRegion *region, uint32_t direction)
{
    if (homography == nullptr || camera_a == nullptr || region == nullptr || direction > 1) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument or bad direction", direction);
        return 0;
    }
    const uint32_t n = plano::track::model_parameter_count(model);
    if (n == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown motion model", model);
        return 0;
    }
    if (!check_information(information, n, __func__)) return 0;
    const M3 ka = normalised_camera_matrix(camera_a), kb = normalised_camera_matrix(&region->camera);
    M3 ka_inv, kb_inv;
    if (!plx_mat33_invert_s(&ka, &ka_inv) || !plx_mat33_invert_s(&kb, &kb_inv)) {
        PLX_ERR_PASS_MSG("camera matrix is singular", 0);
        return 0;
    }
    M3 h;
    if (direction == 0) {
        h = mul(mul(ka_inv, *homography), kb);
    } else {
        h = mul(mul(ka, *homography), kb_inv);
        // Unequal focal lengths take a similarity out of its family; keep the nearest member.
        if (model == TRACK_MODEL_TRANS_ROT_SCALE) {
            const double a = 0.5 * (h.m[0][0] + h.m[1][1]), b = 0.5 * (h.m[1][0] - h.m[0][1]);
            h.m[0][0] = h.m[1][1] = a;
            h.m[0][1] = -b;
            h.m[1][0] = b;
        } else if (model == TRACK_MODEL_TRANS_SCALE) {
            const double s = 0.5 * (h.m[0][0] + h.m[1][1]);
            h.m[0][0] = h.m[1][1] = s;
            h.m[0][1] = h.m[1][0] = 0.0;
        }
    }
    const bool ok = direction == 0 ? transform_information(information, model, ka, kb_inv, __func__)
                                   : transform_information(information, model, ka_inv, kb, __func__);
    if (!ok) return 0;
    *homography = h;
    return 1;
}

PLANO_API Plx_Bool bTrackApplyOffsetsToHomography(Plx_Matrix33 *homography, Plx_SquMatrix *information,
                                                  uint32_t model, const double offset_a[2], double zh_a,
                                                  const double offset_b[2], double zh_b, uint32_t inverse)
{
    if (homography == nullptr || offset_a == nullptr || offset_b == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "missing argument", 0);
        return 0;
    }
    const uint32_t n = plano::track::model_parameter_count(model);
    if (n == 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "unknown motion model", model);
        return 0;
    }
    if (zh_a == 0.0 || zh_b == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "homogeneous coordinate is 0", 0);
        return 0;
    }
    if (!check_information(information, n, __func__)) return 0;
    const double sign = inverse != 0 ? -1.0 : 1.0;
    const double ax = sign * offset_a[0] / zh_a, ay = sign * offset_a[1] / zh_a;
    const double bx = sign * offset_b[0] / zh_b, by = sign * offset_b[1] / zh_b;
    const M3 h = mul(mul(translation(ax, ay), *homography), translation(-bx, -by));
    if (!transform_information(information, model, translation(-ax, -ay), translation(bx, by), __func__))
        return 0;
    *homography = h;
    return 1;
}

}  // extern "C"
