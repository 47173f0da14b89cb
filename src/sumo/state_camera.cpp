// Camera states: a Plx_Camera kept in the user data, some of whose fields (focal lengths,
// centre, distortion coefficients, by type code 8194 to 8203) are the state's parameters.
#include "sumo/state_types.hpp"

using namespace sumo;
using namespace sumo_states;

namespace {

// Camera fields a parameter can stand for; C0.. are the distortion coefficients k[0]...
enum Field : uint8_t { FX, FY, X0, Y0, C0, C1, C2, C3 };
enum Kind : uint8_t { FIXED, RADIAL, XY };

struct CameraCode {
    Kind kind;
    uint8_t coefficients;  // of the camera rebuilt from the state
    uint8_t n;             // parameters
    Field fields[6];
};

const CameraCode kCodes[] = {
    {FIXED, 0, 0, {}},
    {RADIAL, 1, 1, {C0}},
    {RADIAL, 2, 2, {C0, C1}},
    {RADIAL, 3, 3, {C0, C1, C2}},
    {RADIAL, 1, 3, {X0, Y0, C0}},
    {RADIAL, 2, 4, {X0, Y0, C0, C1}},
    {RADIAL, 2, 3, {FY, C0, C1}},
    {RADIAL, 2, 6, {FX, FY, X0, Y0, C0, C1}},
    {XY, 4, 4, {C0, C1, C2, C3}},
    {XY, 4, 6, {X0, Y0, C0, C1, C2, C3}},
};

const CameraCode *code_of(int32_t type)
{
    if (type < SUMO_TYPE_CAMERA_FIXED || type > SUMO_TYPE_CAMERA_CENTRE_XY) return nullptr;
    return &kCodes[type - SUMO_TYPE_CAMERA_FIXED];
}

// Number of distortion coefficients the camera's model has for the code's kind, or -1 when
// the kind does not take the model.
int model_coefficients(const CameraCode &code, int32_t model)
{
    switch (code.kind) {
    case FIXED: return 0;
    case RADIAL: return model >= PLX_LINEAR_CAMERA && model <= PLX_RADIAL_CAMERA_3 ? model : -1;
    default:
        return model == PLX_LINEAR_CAMERA ? 0 : model == PLX_XY_DISTORTION_CAMERA ? 4 : -1;
    }
}

double &field_of(Plx_Camera &c, Field f)
{
    switch (f) {
    case FX: return c.fx;
    case FY: return c.fy;
    case X0: return c.x0;
    case Y0: return c.y0;
    default: return c.k[f - C0];
    }
}

double read_field(const Plx_Camera &c, Field f)
{
    Plx_Camera copy = c;
    return field_of(copy, f);
}

bool build(const CameraCode &code, const Plx_Camera &v, Plx_Camera *out)
{
    switch (code.coefficients) {
    case 1: return plx_camera_build_radial_1(out, v.zh, v.fx, v.fy, v.x0, v.y0, v.k[0]);
    case 2: return plx_camera_build_radial_2(out, v.zh, v.fx, v.fy, v.x0, v.y0, v.k[0], v.k[1]);
    case 3: return plx_camera_build_radial_3(out, v.zh, v.fx, v.fy, v.x0, v.y0, v.k[0], v.k[1], v.k[2]);
    default:
        return plx_camera_build_xy_distortion(out, v.zh, v.fx, v.fy, v.x0, v.y0, v.k[0], v.k[1], v.k[2], v.k[3]);
    }
}

bool read_camera(const SumoStateVector *s, Plx_Camera *camera, const char *function)
{
    const CameraCode *code = code_of(s->x.type);
    if (code == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", s->x.type);
        return false;
    }
    const auto *stored = static_cast<const Plx_Camera *>(s->x.user_data);
    if (stored == nullptr) {
        fail(function, PLX_ERROR_NOT_INITIALISED, "camera state without its camera");
        return false;
    }
    if (dim(s) != code->n) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state dimension does not fit its type", dim(s));
        return false;
    }
    if (code->kind == FIXED) {
        *camera = *stored;
        return true;
    }
    Plx_Camera values = *stored;
    for (uint32_t i = 0; i < code->n; ++i) field_of(values, code->fields[i]) = s->x.v.data[i];
    Plx_Camera built;
    if (!build(*code, values, &built)) {
        pass(function);
        return false;
    }
    built.skew = stored->skew;
    *camera = built;
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoCameraReset(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector *state,
                                    const Plx_Camera *camera, int32_t type)
{
    (void)workspace;
    if (camera == nullptr) {
        fail(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return PLX_FALSE;
    }
    const CameraCode *code = code_of(type);
    if (code == nullptr) {
        fail(__func__, PLX_ERROR_ILLEGAL_TYPE, "camera state type", type);
        return PLX_FALSE;
    }
    const int have = model_coefficients(*code, camera->type);
    if (have < 0) {
        fail(__func__, PLX_ERROR_ILLEGAL_TYPE, "camera model does not fit the state type", camera->type);
        return PLX_FALSE;
    }
    double x[6];
    for (uint32_t i = 0; i < code->n; ++i) {
        const Field f = code->fields[i];
        // A coefficient the model lacks is zero (the model has no distortion of that order).
        x[i] = f >= C0 && int(f - C0) >= have ? 0.0 : read_field(*camera, f);
    }
    if (!check_init(sumo, state, code->n, __func__) || !check_finite(x, code->n, __func__)) return PLX_FALSE;
    void *copy = heap_copy(camera, sizeof(Plx_Camera), __func__);
    if (copy == nullptr) return PLX_FALSE;
    if (!set_dimension(sumo, state, code->n, __func__)) {
        std::free(copy);
        return PLX_FALSE;
    }
    set_user_data(state, copy, copy_bytes<sizeof(Plx_Camera)>);
    return init_state(sumo, state, type, x, code->n, nullptr, __func__);
}

PLANO_API Plx_Bool bSumoCameraRead(const SumoStateVector *state, Plx_Camera *camera)
{
    return check_state(state, camera, __func__) && read_camera(state, camera, __func__);
}

PLANO_API Plx_Bool bSumoCameraProjectPoint(const SumoStateVector *state, const Plx_Vector3 *point, Plx_Vector3 *pixel,
                                           Plx_Matrix *jacobian_point, Plx_Matrix *jacobian_state)
{
    if (!check_state(state, point, __func__) || !check_state(state, pixel, __func__)) return PLX_FALSE;
    Plx_Camera camera;
    if (!read_camera(state, &camera, __func__)) return PLX_FALSE;
    if (camera.point_project == nullptr) {
        fail(__func__, PLX_ERROR_NOT_INITIALISED, "camera without operations");
        return PLX_FALSE;
    }
    const CameraCode &code = *code_of(state->x.type);
    const bool want_state = jacobian_state != nullptr && code.n > 0;
    Plx_Vector3 out;
    Plx_Matrix22 J;
    Plx_Camera deriv[2];
    if (!camera.point_project(&camera, point, &out, jacobian_point != nullptr ? &J : nullptr,
                              want_state ? deriv : nullptr, nullptr)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (jacobian_point != nullptr) {
        if (!plx_mat_resize(jacobian_point, 2, 3)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        const bool affine = camera.type == PLX_AFFINE_CAMERA;
        const double Z = affine ? 1.0 : point->z;
        for (int r = 0; r < 2; ++r) {
            double *row = jacobian_point->data + 3 * r;
            row[0] = J.m[r][0] / Z;
            row[1] = J.m[r][1] / Z;
            row[2] = affine ? 0.0 : -(J.m[r][0] * point->x + J.m[r][1] * point->y) / (Z * Z);
        }
    }
    if (jacobian_state != nullptr) {
        if (!plx_mat_resize(jacobian_state, 2, code.n)) {
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
        for (int r = 0; r < 2 && want_state; ++r)
            for (uint32_t i = 0; i < code.n; ++i)
                jacobian_state->data[r * code.n + i] = field_of(deriv[r], code.fields[i]);
    }
    *pixel = out;
    return PLX_TRUE;
}

PLANO_API SumoStateVector *pSumoCameraNew(Sumo *sumo, SumoBranch *branch, const Plx_Camera *camera, int32_t type,
                                          int32_t label, const ThreadHostInterface *host)
{
    const CameraCode *code = code_of(type);
    if (code == nullptr) {
        fail(__func__, PLX_ERROR_ILLEGAL_TYPE, "camera state type", type);
        return nullptr;
    }
    SumoStateVector *state = pSumoStateVectorNew(sumo, branch, code->n, nullptr, host);
    if (state == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    if (!bSumoCameraReset(sumo, nullptr, state, camera, type)) {
        // Still uninitialised and unobserved: removing it cannot fail or touch the trace.
        bSumoStateDelete(sumo, nullptr, state, host);
        PLX_ERR_PASS();
        return nullptr;
    }
    state->x.label = label;
    state->io_tag = SUMO_IO_TAG_CAMERA;
    return state;
}

}  // extern "C"
