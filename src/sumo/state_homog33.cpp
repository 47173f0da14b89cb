// Homography states: the nine entries of a 3x3 matrix known up to scale, held at unit norm
// by a scale observation (4097), fixed (4098), or with one entry fixed at 1 (4099 to 4107).
// The float twins convert at the interface and share everything else.
#include "pellux/detail/precision.hpp"
#include "sumo/state_types.hpp"

using namespace sumo_states;

namespace {

const double kIdentity[9] = {1, 0, 0, 0, 1, 0, 0, 0, 1};

const Family kHomog33 = {9,
                         SUMO_TYPE_HOMOG33,
                         SUMO_TYPE_HOMOG33_FIXED,
                         SUMO_TYPE_HOMOG33_MINIMAL0,
                         0,
                         bSumoHomog33ScaleH,
                         kIdentity};

template <class M>
bool entries(const M *H, double *v)
{
    if (H == nullptr) return false;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) v[3 * r + c] = double(H->m[r][c]);
    return true;
}

template <class S>
using Mat33 = typename plx::Precision<S>::Mat33;

template <class S>
bool init(Sumo *sumo, SumoStateVector *s, const Mat33<S> *H, const char *function)
{
    double v[9];
    return family_init(kHomog33, sumo, s, entries(H, v) ? v : nullptr, function);
}

template <class S>
bool init_fixed(Sumo *sumo, SumoStateVector *s, const Mat33<S> *H, const char *function)
{
    double v[9];
    return family_init_fixed(kHomog33, sumo, s, entries(H, v) ? v : nullptr, function);
}

template <class S>
bool init_minimal(Sumo *sumo, SumoStateVector *s, const Mat33<S> *H, const char *function)
{
    double v[9];
    return family_init_minimal(kHomog33, sumo, s, entries(H, v) ? v : nullptr, function);
}

template <class S>
bool reset(SumoStateVector *s, const Mat33<S> *H, const char *function)
{
    double v[9];
    return check_state(s, H, function) && entries(H, v) && family_reset(kHomog33, s, v, function);
}

template <class S>
bool read(const SumoStateVector *s, Mat33<S> *H, const char *function)
{
    double v[9];
    if (!check_state(s, H, function) || !family_read(kHomog33, s, v, function)) return false;
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) H->m[r][c] = S(v[3 * r + c]);
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSumoHomog33Init(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *H)
{
    return init<double>(sumo, state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33InitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *H)
{
    return init_fixed<double>(sumo, state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33InitMinimal(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33 *H)
{
    return init_minimal<double>(sumo, state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33Reset(SumoStateVector *state, const Plx_Matrix33 *H)
{
    return reset<double>(state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33Read(const SumoStateVector *state, Plx_Matrix33 *H)
{
    return read<double>(state, H, __func__);
}

PLANO_API Plx_Bool bSumoHomog33FInit(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33_f *H)
{
    return init<float>(sumo, state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33FInitFixed(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33_f *H)
{
    return init_fixed<float>(sumo, state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33FInitMinimal(Sumo *sumo, SumoStateVector *state, const Plx_Matrix33_f *H)
{
    return init_minimal<float>(sumo, state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33FReset(SumoStateVector *state, const Plx_Matrix33_f *H)
{
    return reset<float>(state, H, __func__);
}
PLANO_API Plx_Bool bSumoHomog33FRead(const SumoStateVector *state, Plx_Matrix33_f *H)
{
    return read<float>(state, H, __func__);
}

PLANO_API Plx_Bool bSumoHomog33FillJacobian1(Plx_Matrix *J, const double d[9], double scale, int32_t type)
{
    return family_fill(kHomog33, J, d, 1, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoHomog33FillJacobian2(Plx_Matrix *J, const double d[18], double scale, int32_t type)
{
    return family_fill(kHomog33, J, d, 2, scale, type, __func__);
}
PLANO_API Plx_Bool bSumoHomog33FillJacobian(Plx_Matrix *J, const Plx_Matrix *d, double scale, int32_t type)
{
    uint32_t cols[9];
    const int n = family_columns(kHomog33, type, cols);
    if (n < 0) {
        fail(__func__, PLX_ERROR_ILLEGAL_TYPE, "state type", type);
        return PLX_FALSE;
    }
    return fill_columns_matrix(J, d, 9, cols, uint32_t(n), scale, __func__);
}

PLANO_API Plx_Bool bSumoHomog33ScaleH(Sumo *sumo, SumoWorkspace *workspace, SumoStateVector **states,
                                      uint32_t n_states, const SumoVector *z, Plx_Vector *h, Plx_Matrix **jacobians)
{
    (void)sumo;
    (void)workspace;
    (void)z;
    return scale_h(states, n_states, h, jacobians, __func__);
}

}  // extern "C"
