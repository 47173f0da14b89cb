// Affine motion states: the 2x3 matrix [a b c; d e f] in full (4353), fixed (4354), as a
// translation (4355), translation and scale (4356) or translation, rotation and scale
// (4357). The float twins convert at the interface and share everything else.
#include "sumo/state_types.hpp"

using namespace sumo;
using namespace sumo_states;

namespace {

const double kIdentity[6] = {1, 0, 0, 0, 1, 0};

template <class S>
struct Mat23Of;
template <>
struct Mat23Of<double> {
    using type = Plx_Matrix23;
};
template <>
struct Mat23Of<float> {
    using type = Plx_Matrix23_f;
};
template <class S>
using Mat23 = typename Mat23Of<S>::type;

int affine_dim(int32_t type)
{
    switch (type) {
    case SUMO_TYPE_AFFHOMOG33: return 6;
    case SUMO_TYPE_AFFHOMOG33_FIXED: return 0;
    case SUMO_TYPE_AFFHOMOG33_TRANSLATION: return 2;
    case SUMO_TYPE_AFFHOMOG33_TRANS_SCALE: return 3;
    case SUMO_TYPE_AFFHOMOG33_TRANS_ROT_SCALE: return 4;
    default: return -1;
    }
}

// Parameters of the code from a..f (v).
void params(int32_t type, const double *v, double *x)
{
    switch (type) {
    case SUMO_TYPE_AFFHOMOG33: std::memcpy(x, v, sizeof(double) * 6); break;
    case SUMO_TYPE_AFFHOMOG33_TRANSLATION:
        x[0] = v[2];
        x[1] = v[5];
        break;
    case SUMO_TYPE_AFFHOMOG33_TRANS_SCALE:
        x[0] = 0.5 * (v[0] + v[4]);
        x[1] = v[2];
        x[2] = v[5];
        break;
    case SUMO_TYPE_AFFHOMOG33_TRANS_ROT_SCALE:
        x[0] = 0.5 * (v[0] + v[4]);
        x[1] = v[2];
        x[2] = 0.5 * (v[3] - v[1]);
        x[3] = v[5];
        break;
    default: break;
    }
}

bool read_entries(const SumoStateVector *s, double *v, const char *function)
{
    const int32_t type = s->x.type;
    const int n = affine_dim(type);
    if (n < 0) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
    if (type == SUMO_TYPE_AFFHOMOG33_FIXED) {
        const auto *stored = static_cast<const double *>(s->x.user_data);
        std::memcpy(v, stored != nullptr ? stored : kIdentity, sizeof(double) * 6);
        return true;
    }
    if (dim(s) != uint32_t(n)) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state dimension does not fit its type", dim(s));
        return false;
    }
    const double *x = s->x.v.data;
    switch (type) {
    case SUMO_TYPE_AFFHOMOG33: std::memcpy(v, x, sizeof(double) * 6); break;
    case SUMO_TYPE_AFFHOMOG33_TRANSLATION: {
        const double w[6] = {1, 0, x[0], 0, 1, x[1]};
        std::memcpy(v, w, sizeof w);
        break;
    }
    case SUMO_TYPE_AFFHOMOG33_TRANS_SCALE: {
        const double w[6] = {x[0], 0, x[1], 0, x[0], x[2]};
        std::memcpy(v, w, sizeof w);
        break;
    }
    default: {
        const double w[6] = {x[0], -x[2], x[1], x[2], x[0], x[3]};
        std::memcpy(v, w, sizeof w);
        break;
    }
    }
    return true;
}

template <class S>
const double *entries(const Mat23<S> *A, double *v)
{
    if (A == nullptr) return nullptr;
    for (int r = 0; r < 2; ++r)
        for (int c = 0; c < 3; ++c) v[3 * r + c] = double(A->m[r][c]);
    return v;
}

template <class S>
bool init(Sumo *sumo, SumoStateVector *s, const Mat23<S> *A, int32_t type, const char *function)
{
    double v[6], x[6];
    if (entries<S>(A, v) == nullptr) {
        fail(function, PLX_ERROR_ILLEGAL_ARGUMENT, "null argument");
        return false;
    }
    params(type, v, x);
    return init_state(sumo, s, type, x, uint32_t(affine_dim(type)), nullptr, function);
}

template <class S>
bool init_fixed(Sumo *sumo, SumoStateVector *s, const Mat23<S> *A, const char *function)
{
    double v[6];
    return sumo_states::init_fixed(sumo, s, SUMO_TYPE_AFFHOMOG33_FIXED, entries<S>(A, v), sizeof v,
                                   copy_bytes<sizeof v>, function);
}

template <class S>
bool reset(SumoStateVector *s, const Mat23<S> *A, const char *function)
{
    double v[6];
    if (!check_state(s, A, function)) return false;
    const int32_t type = s->x.type;
    const int n = affine_dim(type);
    if (n < 0) {
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
    if (dim(s) != uint32_t(n)) {
        fail(function, PLX_ERROR_INCOMPATIBLE, "state dimension does not fit its type", dim(s));
        return false;
    }
    if (!check_finite(entries<S>(A, v), 6, function)) return false;
    params(type, v, s->x.v.data);
    return true;
}

template <class S>
bool read(const SumoStateVector *s, Mat23<S> *A, const char *function)
{
    double v[6];
    if (!check_state(s, A, function) || !read_entries(s, v, function)) return false;
    for (int r = 0; r < 2; ++r)
        for (int c = 0; c < 3; ++c) A->m[r][c] = S(v[3 * r + c]);
    return true;
}

bool fill(Plx_Matrix *J, const double *d, uint32_t rows, double scale, int32_t type, const char *function)
{
    static const uint32_t all[6] = {0, 1, 2, 3, 4, 5}, translation[2] = {2, 5};
    switch (type) {
    case SUMO_TYPE_AFFHOMOG33: return fill_columns(J, d, rows, 6, all, 6, scale, function);
    case SUMO_TYPE_AFFHOMOG33_FIXED: return fill_columns(J, d, rows, 6, all, 0, scale, function);
    case SUMO_TYPE_AFFHOMOG33_TRANSLATION: return fill_columns(J, d, rows, 6, translation, 2, scale, function);
    default:
        // Scale and rotation parameters tie several entries together: not a column selection.
        fail(function, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return false;
    }
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoAffHomog33Init(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A)
{
    return init<double>(sumo, state, A, SUMO_TYPE_AFFHOMOG33, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33InitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A)
{
    return init_fixed<double>(sumo, state, A, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33InitTranslation(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A)
{
    return init<double>(sumo, state, A, SUMO_TYPE_AFFHOMOG33_TRANSLATION, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33InitTransScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A)
{
    return init<double>(sumo, state, A, SUMO_TYPE_AFFHOMOG33_TRANS_SCALE, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33InitTransRotScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23 *A)
{
    return init<double>(sumo, state, A, SUMO_TYPE_AFFHOMOG33_TRANS_ROT_SCALE, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33Reset(SumoStateVector *state, const Plx_Matrix23 *A)
{
    return reset<double>(state, A, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33Read(const SumoStateVector *state, Plx_Matrix23 *A)
{
    return read<double>(state, A, __func__);
}

PLANO_API Plx_Bool bSumoAffHomog33FInit(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A)
{
    return init<float>(sumo, state, A, SUMO_TYPE_AFFHOMOG33, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33FInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A)
{
    return init_fixed<float>(sumo, state, A, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33FInitTranslation(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A)
{
    return init<float>(sumo, state, A, SUMO_TYPE_AFFHOMOG33_TRANSLATION, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33FInitTransScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A)
{
    return init<float>(sumo, state, A, SUMO_TYPE_AFFHOMOG33_TRANS_SCALE, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33FInitTransRotScale(Sumo *sumo, SumoStateVector *state, const Plx_Matrix23_f *A)
{
    return init<float>(sumo, state, A, SUMO_TYPE_AFFHOMOG33_TRANS_ROT_SCALE, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33FReset(SumoStateVector *state, const Plx_Matrix23_f *A)
{
    return reset<float>(state, A, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33FRead(const SumoStateVector *state, Plx_Matrix23_f *A)
{
    return read<float>(state, A, __func__);
}

PLANO_API Plx_Bool bSumoAffHomog33FillJacobian1(Plx_Matrix *J, const double d[6], double scale, int32_t type)
{
    return fill(J, d, 1, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoAffHomog33FillJacobian2(Plx_Matrix *J, const double d[12], double scale, int32_t type)
{
    return fill(J, d, 2, scale, type, __func__);
}

}  // extern "C"
