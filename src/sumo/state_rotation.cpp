// 3D rotation states. The parameters are a small rotation x (an exponential vector) applied
// on the left of a reference rotation kept as a quaternion in the user data:
// R = exp([x]) R0. Three parameters thus cover every rotation without the singularities of
// angles, and the adjust function keeps x near zero by folding it into R0 after each step.
#include <cmath>

#include "sumo/state_types.hpp"

using namespace sumo;
using namespace sumo_states;

namespace {

// The reference, and the reference before the last fold (restored when the solver
// reinstates the old parameters).
struct RotationData {
    Plx_Quaternion reference, previous;
};
static_assert(sizeof(RotationData) == 64, "two quaternions");

const Plx_Quaternion kIdentity = {1, 0, 0, 0};

// The rotation of the state as a quaternion.
bool quaternion_of(const SumoStateVector *s, Plx_Quaternion *q, const char *function)
{
    const int32_t type = s->x.type;
    if (type != SUMO_TYPE_ROTATE3D && type != SUMO_TYPE_ROTATE3D_FIXED) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
    const auto *data = static_cast<const RotationData *>(s->x.user_data);
    if (type == SUMO_TYPE_ROTATE3D_FIXED) {
        *q = data != nullptr ? data->reference : kIdentity;
        return true;
    }
    if (data == nullptr) {
        fail(function, PLX_ERROR_NOT_INITIALISED, "rotation without its reference");
        return false;
    }
    if (dim(s) != 3) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state dimension does not fit its type", dim(s));
        return false;
    }
    const Plx_Vector3 x = {s->x.v.data[0], s->x.v.data[1], s->x.v.data[2]};
    Plx_Quaternion dq, r;
    if (!plx_quaternion_from_exponential(&x, &dq) || !plx_quaternion_mult(&dq, &data->reference, &r) ||
        !plx_quaternion_normalise(&r, q)) {
        pass(function);
        return false;
    }
    return true;
}

bool reference_of(const Plx_Matrix33 *R, RotationData *data, const char *function)
{
    if (!plx_quaternion_from_rot3D(R, &data->reference)) {
        pass(function);
        return false;
    }
    data->previous = data->reference;
    return true;
}

// [v]x, the cross-product matrix.
void cross_matrix(const double *v, double m[3][3])
{
    m[0][0] = 0;
    m[0][1] = -v[2];
    m[0][2] = v[1];
    m[1][0] = v[2];
    m[1][1] = 0;
    m[1][2] = -v[0];
    m[2][0] = -v[1];
    m[2][1] = v[0];
    m[2][2] = 0;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoRotate3DInit(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *R)
{
    RotationData data;
    if (R == nullptr) {
        fail(__func__, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return PLX_FALSE;
    }
    if (!reference_of(R, &data, __func__) || !check_init(sumo, state, 3, __func__)) return PLX_FALSE;
    auto *heap = static_cast<RotationData *>(heap_copy(&data, sizeof data, __func__));
    if (heap == nullptr) return PLX_FALSE;
    if (!set_dimension(sumo, state, 3, __func__)) {
        std::free(heap);
        return PLX_FALSE;
    }
    set_user_data(state, heap, copy_bytes<sizeof(RotationData)>);
    const double zero[3] = {0, 0, 0};
    if (!init_state(sumo, state, SUMO_TYPE_ROTATE3D, zero, 3, nullptr, __func__)) return PLX_FALSE;
    state->adjust_func = bSumoRotate3DAdjust;
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoRotate3DInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *R)
{
    RotationData data;
    if (R != nullptr && !reference_of(R, &data, __func__)) return PLX_FALSE;
    return init_fixed(sumo, state, SUMO_TYPE_ROTATE3D_FIXED, R != nullptr ? &data : nullptr, sizeof data,
                      copy_bytes<sizeof(RotationData)>, __func__);
}

PLANO_API Plx_Bool bSumoRotate3DReset(SumoStateVector *state, const Plx_Matrix33 *R)
{
    if (!check_state(state, R, __func__)) return PLX_FALSE;
    const int32_t type = state->x.type;
    if (type != SUMO_TYPE_ROTATE3D && type != SUMO_TYPE_ROTATE3D_FIXED) {
        fail(__func__, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return PLX_FALSE;
    }
    if (type == SUMO_TYPE_ROTATE3D && (dim(state) != 3 || state->x.user_data == nullptr)) {
        fail(__func__, PLX_ERROR_NOT_INITIALISED, "rotation without its reference");
        return PLX_FALSE;
    }
    RotationData data;
    if (!reference_of(R, &data, __func__)) return PLX_FALSE;
    if (state->x.user_data == nullptr) {
        void *heap = heap_copy(&data, sizeof data, __func__);
        if (heap == nullptr) return PLX_FALSE;
        set_user_data(state, heap, copy_bytes<sizeof(RotationData)>);
    } else {
        *static_cast<RotationData *>(state->x.user_data) = data;
    }
    if (type == SUMO_TYPE_ROTATE3D) std::memset(state->x.v.data, 0, sizeof(double) * 3);
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoRotate3DRead(const SumoStateVector *state, Plx_Matrix33 *R)
{
    Plx_Quaternion q;
    if (!check_state(state, R, __func__) || !quaternion_of(state, &q, __func__)) return PLX_FALSE;
    if (!plx_rot3D_from_quaternion_q(&q, R)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoRotate3DAdjust(Sumo *sumo, uint32_t mode, SumoStateVector *state)
{
    (void)sumo;
    if (state == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    auto *data = static_cast<RotationData *>(state->x.user_data);
    if (state->x.type != SUMO_TYPE_ROTATE3D || data == nullptr || dim(state) != 3) {
        PLX_ERR_START(PLX_ERROR_NOT_INITIALISED, "not a rotation state", state->x.type);
        return PLX_FALSE;
    }
    if (mode == 1) {
        // The old parameters were relative to the reference before the last fold.
        data->reference = data->previous;
        return PLX_TRUE;
    }
    Plx_Quaternion q;
    if (!quaternion_of(state, &q, __func__)) return PLX_FALSE;
    data->previous = data->reference;
    data->reference = q;
    std::memset(state->x.v.data, 0, sizeof(double) * 3);
    return PLX_TRUE;
}

PLANO_API Plx_Bool bSumoRotate3DJacobian(const SumoStateVector *state, Plx_Matrix *J)
{
    Plx_Matrix33 R;
    if (!check_state(state, J, __func__)) return PLX_FALSE;
    if (!bSumoRotate3DRead(state, &R)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    const uint32_t n = state->x.type == SUMO_TYPE_ROTATE3D ? 3 : 0;
    if (!plx_mat_resize(J, 9, n)) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    if (n == 0) return PLX_TRUE;
    // d exp([x + t e_k]) / dt = [Jl(x) e_k]x exp([x]) with the left Jacobian
    // Jl = I + a [x]x + b [x]x^2, a = (1 - cos t)/t^2, b = (t - sin t)/t^3, t = |x|.
    const double *x = state->x.v.data;
    const double t2 = x[0] * x[0] + x[1] * x[1] + x[2] * x[2], t = std::sqrt(t2);
    double a, b;
    if (t < 1e-4) {
        a = 0.5 - t2 / 24.0;
        b = 1.0 / 6.0 - t2 / 120.0;
    } else {
        a = (1.0 - std::cos(t)) / t2;
        b = (t - std::sin(t)) / (t2 * t);
    }
    double X[3][3], X2[3][3];
    cross_matrix(x, X);
    for (int i = 0; i < 3; ++i)
        for (int j = 0; j < 3; ++j) X2[i][j] = X[i][0] * X[0][j] + X[i][1] * X[1][j] + X[i][2] * X[2][j];
    for (int k = 0; k < 3; ++k) {
        double w[3], W[3][3];
        for (int i = 0; i < 3; ++i) w[i] = (i == k ? 1.0 : 0.0) + a * X[i][k] + b * X2[i][k];
        cross_matrix(w, W);
        for (int r = 0; r < 3; ++r)
            for (int c = 0; c < 3; ++c)
                J->data[(3 * r + c) * 3 + k] = W[r][0] * R.m[0][c] + W[r][1] * R.m[1][c] + W[r][2] * R.m[2][c];
    }
    return PLX_TRUE;
}

}  // extern "C"
