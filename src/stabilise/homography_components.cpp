// The eight components of a homography (rotation, translation, scale, shear, aspect,
// perspective), their exact reconstruction and their interpolation.
#include "stabilise/stabilise_internal.hpp"

namespace {

using plano::stabilise::given;

struct Block22 {
    double a00, a01, a10, a11;
};

// R(a)^T B R(a) (sign -1) or R(a) B R(a)^T (sign +1): the block seen along or put back from
// the reference direction. Both are Q B Q^T with Q = R(sign * a).
Block22 conjugate(const Block22 &b, double angle, double sign)
{
    const double c = std::cos(angle), s = sign * std::sin(angle);
    // T = B Q^T, then Q T.
    const double t00 = b.a00 * c - b.a01 * s, t01 = b.a00 * s + b.a01 * c;
    const double t10 = b.a10 * c - b.a11 * s, t11 = b.a10 * s + b.a11 * c;
    return {c * t00 - s * t10, c * t01 - s * t11, s * t00 + c * t10, s * t01 + c * t11};
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bDecomposeHomography(const Plx_Matrix33 *H, double ref_angle, HomographyComponents *components)
{
    if (!given(__func__, H, components)) return 0;
    const auto &h = H->m;
    const double h22 = h[2][2];
    if (h22 == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "h22 is zero", 0);
        return 0;
    }
    const double g = h[2][0] / h22, hh = h[2][1] / h22;
    const double tx = h[0][2] / h22, ty = h[1][2] / h22;
    const Block22 a{h[0][0] / h22 - tx * g, h[0][1] / h22 - tx * hh, h[1][0] / h22 - ty * g, h[1][1] / h22 - ty * hh};
    if (a.a00 == 0.0 && a.a10 == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "first column is zero", 0);
        return 0;
    }
    const Block22 r = conjugate(a, ref_angle, -1.0);
    const double s2 = r.a00 * r.a00 + r.a10 * r.a10;
    const double s = std::sqrt(s2);
    if (s == 0.0) {
        PLX_ERR_START(PLX_ERROR_DIVISION_BY_ZERO, "scale is zero", 0);
        return 0;
    }
    double *c = components->c;
    c[PLANO_COMPONENT_ROTATION] = std::atan2(r.a10, r.a00);
    c[PLANO_COMPONENT_X_TRANSLATION] = tx;
    c[PLANO_COMPONENT_Y_TRANSLATION] = ty;
    c[PLANO_COMPONENT_SCALE] = s;
    c[PLANO_COMPONENT_SHEAR] = (r.a00 * r.a01 + r.a10 * r.a11) / s2;
    c[PLANO_COMPONENT_ASPECT] = (r.a00 * r.a11 - r.a10 * r.a01) / s2;
    c[PLANO_COMPONENT_PERSPECTIVE_X] = g;
    c[PLANO_COMPONENT_PERSPECTIVE_Y] = hh;
    return 1;
}

PLANO_API Plx_Bool bReconstructHomography(const HomographyComponents *components, double ref_angle, Plx_Matrix33 *H)
{
    if (!given(__func__, components, H)) return 0;
    const double *c = components->c;
    const double cr = std::cos(c[PLANO_COMPONENT_ROTATION]), sr = std::sin(c[PLANO_COMPONENT_ROTATION]);
    const double s = c[PLANO_COMPONENT_SCALE], shear = c[PLANO_COMPONENT_SHEAR], aspect = c[PLANO_COMPONENT_ASPECT];
    const Block22 r{s * cr, s * (cr * shear - sr * aspect), s * sr, s * (sr * shear + cr * aspect)};
    const Block22 a = conjugate(r, ref_angle, 1.0);
    const double tx = c[PLANO_COMPONENT_X_TRANSLATION], ty = c[PLANO_COMPONENT_Y_TRANSLATION];
    const double g = c[PLANO_COMPONENT_PERSPECTIVE_X], h = c[PLANO_COMPONENT_PERSPECTIVE_Y];
    *H = Plx_Matrix33{{{a.a00 + tx * g, a.a01 + tx * h, tx}, {a.a10 + ty * g, a.a11 + ty * h, ty}, {g, h, 1.0}}};
    return 1;
}

PLANO_API Plx_Bool bInterpolateComponents(HomographyComponents *out, const HomographyComponents *a,
                                          const HomographyComponents *b, double t, uint32_t mask)
{
    using namespace plano::stabilise;
    if (!given(__func__, out, a, b)) return 0;
    for (int i = 0; i < PLANO_COMPONENT_COUNT; ++i) {
        if ((mask & kComponentMask[i]) == 0) continue;
        const double x = a->c[i], y = b->c[i];
        switch (kind_of(i)) {
        case Kind::kAngle: out->c[i] = interpolate_angle(x, y, t); break;
        case Kind::kScale: out->c[i] = std::pow(x, 1.0 - t) * std::pow(y, t); break;
        case Kind::kLinear: out->c[i] = (1.0 - t) * x + t * y; break;
        }
    }
    return 1;
}

}  // extern "C"
