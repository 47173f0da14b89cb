// Stabilising a shot: every frame's homography becomes a smooth reference motion through the
// anchor frames times a residual, whose chosen components are flattened or smoothed before
// the two are put back together.
#include <cstring>

#include "pellux/fixed.h"
#include "stabilise/stabilise_internal.hpp"

namespace {

using namespace plano::stabilise;

constexpr const char *kName = "bSmoothHomographies";
// Frames outside the anchors keep this much of their distance from the nearest anchor per
// iteration, so that smoothing cannot let the ends drift away.
constexpr double kCompression = 0.99;
// Levels of the root chain beyond log2 of the anchor gap: 64 steps per frame.
constexpr double kExtraLevels = 6.0;

bool callee_failed()
{
    plx_err_register_fileline(kName, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
    return false;
}
bool division_by_zero(const char *message)
{
    PLX_ERR_START_AS(kName, PLX_ERROR_DIVISION_BY_ZERO, message, 0);
    return false;
}

Plx_Matrix33 product(const Plx_Matrix33 &a, const Plx_Matrix33 &b)
{
    Plx_Matrix33 ab;
    plx_mat33_rmultm33_s(&a, &b, &ab);
    return ab;
}
Plx_Matrix33 translation(double x, double y) { return Plx_Matrix33{{{1.0, 0.0, x}, {0.0, 1.0, y}, {0.0, 0.0, 1.0}}}; }

// A heap array that registers code 5 under the exported name when it cannot be had.
template <class T>
plx::HeapPtr<T> array(std::size_t n)
{
    return plx::HeapPtr<T>(plx::heap_alloc<T>(n, kName, __FILE__, __LINE__));
}

// The frames where given motion, points and angles are read: the anchors in increasing
// order, or the middle frame when there is none.
struct KeyFrames {
    plx::HeapPtr<uint32_t> frame;
    uint32_t count = 0;
    bool anchored = false;

    bool make(const uint32_t *anchors, uint32_t n)
    {
        for (uint32_t i = 0; anchors != nullptr && i < n; ++i) count += anchors[i] != 0;
        anchored = count > 0;
        frame = array<uint32_t>(anchored ? count : 1);
        if (frame == nullptr) return false;
        if (!anchored) {
            frame.get()[0] = n / 2;
            count = 1;
            return true;
        }
        for (uint32_t i = 0, k = 0; i < n; ++i)
            if (anchors[i] != 0) frame.get()[k++] = i;
        return true;
    }
    uint32_t first() const { return frame.get()[0]; }
    uint32_t last() const { return frame.get()[count - 1]; }
    uint32_t operator[](uint32_t k) const { return frame.get()[k]; }
};

// Calls f(i, a, b, t) for every frame i that is not a key frame: between key frames a < b
// with t = (i - a) / (b - a), before the first and after the last with a = b = that frame.
template <class F>
void between_keys(const KeyFrames &keys, uint32_t n, F &&f)
{
    for (uint32_t i = 0; i < keys.first(); ++i) f(i, keys.first(), keys.first(), 0.0);
    for (uint32_t k = 0; k + 1 < keys.count; ++k) {
        const uint32_t a = keys[k], b = keys[k + 1];
        for (uint32_t i = a + 1; i < b; ++i) f(i, a, b, static_cast<double>(i - a) / static_cast<double>(b - a));
    }
    for (uint32_t i = keys.last() + 1; i < n; ++i) f(i, keys.last(), keys.last(), 0.0);
}

// The reference motion: the key frames' own homographies, and between two of them the
// geometric path M^t H_a with M = H_b H_a^-1.
bool reference_motion(const Plx_Matrix33 *in, uint32_t n, const KeyFrames &keys, Plx_Matrix33 *R)
{
    for (uint32_t k = 0; k < keys.count; ++k) R[keys[k]] = in[keys[k]];
    for (uint32_t i = 0; i < keys.first(); ++i) R[i] = in[keys.first()];
    for (uint32_t i = keys.last() + 1; i < n; ++i) R[i] = in[keys.last()];
    for (uint32_t k = 0; k + 1 < keys.count; ++k) {
        const uint32_t a = keys[k], b = keys[k + 1];
        if (b - a < 2) continue;
        Plx_Matrix33 Ha_inv;
        if (!plx_mat33_invert_s(&in[a], &Ha_inv)) return callee_failed();
        const Plx_Matrix33 M = product(in[b], Ha_inv);
        const auto levels = static_cast<uint32_t>(std::log2(static_cast<double>(b - a)) + kExtraLevels);
        Matrix33GeneralRoot root{};
        if (!bMatrix33GeneralRootInit(&M, levels, &root)) return callee_failed();
        for (uint32_t i = a + 1; i < b; ++i) {
            Plx_Matrix33 Mt;
            bMatrix33GeneralRoot(&root, static_cast<double>(i - a) / static_cast<double>(b - a), &Mt);
            R[i] = product(Mt, in[a]);
        }
        vMatrix33GeneralRootFree(&root);
    }
    return true;
}

Plx_Vector3 map_point(const Plx_Matrix33 &H, double x, double y)
{
    const Plx_Vector3 p{x, y, 1.0};
    Plx_Vector3 q;
    plx_mat33_multv3_s(&H, &p, &q);
    return q;
}

// Reference points (w = 1) and angles of every frame: the given ones at the key frames
// mapped back through the inverse residual, interpolated between them. Without given points
// the angle is carried along from the origin.
bool reference_frames(const Plx_Matrix33 *Q, uint32_t n, const KeyFrames &keys, const Plx_Vector3 *given_points,
                      const double *given_angles, Plx_Vector3 *P, double *angle)
{
    for (uint32_t k = 0; k < keys.count; ++k) {
        const uint32_t a = keys[k];
        Plx_Matrix33 Qinv;
        if (!plx_mat33_invert_s(&Q[a], &Qinv)) return callee_failed();
        const Plx_Vector3 g = given_points != nullptr ? given_points[a] : Plx_Vector3{0.0, 0.0, 1.0};
        if (g.z == 0.0) return division_by_zero("reference point at infinity");
        const double x = g.x / g.z, y = g.y / g.z;
        const Plx_Vector3 p = map_point(Qinv, x, y);
        if (p.z == 0.0) return division_by_zero("reference point maps to infinity");
        P[a] = Plx_Vector3{p.x / p.z, p.y / p.z, 1.0};
        if (given_angles == nullptr) continue;
        const Plx_Vector3 q = map_point(Qinv, x + std::cos(given_angles[a]), y + std::sin(given_angles[a]));
        if (q.z == 0.0) return division_by_zero("reference direction maps to infinity");
        const double dx = q.x / q.z - P[a].x, dy = q.y / q.z - P[a].y;
        if (dx == 0.0 && dy == 0.0) return division_by_zero("reference direction vanishes");
        angle[a] = std::atan2(dy, dx);
    }
    between_keys(keys, n, [&](uint32_t i, uint32_t a, uint32_t b, double t) {
        P[i] = Plx_Vector3{(1.0 - t) * P[a].x + t * P[b].x, (1.0 - t) * P[a].y + t * P[b].y, 1.0};
        if (given_angles != nullptr) angle[i] = interpolate_angle(angle[a], angle[b], t);
    });
    return true;
}

// Full stabilisation without anchors: every frame takes the mean of all frames.
void flatten_to_mean(HomographyComponents *C, uint32_t n, uint32_t mask)
{
    HomographyComponents mean = C[0];
    for (int c = 0; c < PLANO_COMPONENT_COUNT; ++c) {
        if ((mask & kComponentMask[c]) == 0) continue;
        const Kind kind = kind_of(c);
        double sum = 0.0, running = C[0].c[c];
        for (uint32_t i = 0; i < n; ++i) {
            const double v = C[i].c[c];
            if (kind == Kind::kAngle && i > 0) running = interpolate_angle(running, v, 1.0 / (i + 1.0));
            sum += kind == Kind::kScale ? std::log(v) : v;
        }
        mean.c[c] = kind == Kind::kAngle ? running : kind == Kind::kScale ? std::exp(sum / n) : sum / n;
    }
    // Interpolating the mean with itself copies exactly its masked components.
    for (uint32_t i = 0; i < n; ++i) bInterpolateComponents(&C[i], &mean, &mean, 0.0, mask);
}

double smoothed(Kind kind, double previous, double value, double next)
{
    switch (kind) {
    case Kind::kAngle: return interpolate_angle(interpolate_angle(previous, next, 0.5), value, 0.5);
    case Kind::kScale: return std::sqrt(std::sqrt(previous * next) * value);
    case Kind::kLinear: break;
    }
    return 0.25 * (previous + next) + 0.5 * value;
}

// Pulls the masked components of v towards the anchor's.
bool compress(HomographyComponents &v, const HomographyComponents &anchor, uint32_t mask)
{
    for (int c = 0; c < PLANO_COMPONENT_COUNT; ++c) {
        if ((mask & kComponentMask[c]) == 0) continue;
        const double a = anchor.c[c];
        switch (kind_of(c)) {
        case Kind::kAngle: v.c[c] = interpolate_angle(a, v.c[c], kCompression); break;
        case Kind::kScale:
            if (a == 0.0) return division_by_zero("anchor scale is zero");
            v.c[c] = a * std::pow(v.c[c] / a, kCompression);
            break;
        case Kind::kLinear: v.c[c] = a + kCompression * (v.c[c] - a); break;
        }
    }
    return true;
}

// One iteration of smoothing: every frame from its neighbours' previous values (so the
// result does not depend on the order of the frames), then the compression outside the
// anchors (towards the middle frame when there is none).
bool smooth_once(HomographyComponents *C, HomographyComponents *previous, uint32_t n, const uint32_t *anchors,
                 const KeyFrames &keys, uint32_t mask)
{
    std::memcpy(previous, C, n * sizeof *C);
    for (uint32_t i = 1; i + 1 < n; ++i) {
        if (keys.anchored && anchors[i] != 0) continue;
        for (int c = 0; c < PLANO_COMPONENT_COUNT; ++c)
            if ((mask & kComponentMask[c]) != 0)
                C[i].c[c] = smoothed(kind_of(c), previous[i - 1].c[c], previous[i].c[c], previous[i + 1].c[c]);
    }
    for (uint32_t i = 0; i < keys.first(); ++i)
        if (!compress(C[i], C[keys.first()], mask)) return false;
    for (uint32_t i = keys.last() + 1; i < n; ++i)
        if (!compress(C[i], C[keys.last()], mask)) return false;
    return true;
}

uint32_t component_mask(const int32_t flags[8])
{
    // Flag order of the interface: x and y translation, rotation, scale, shear, aspect,
    // perspective x and y, which is the order of the mask bits.
    uint32_t mask = 0;
    for (int k = 0; k < 8; ++k)
        if (flags[k] != 0) mask |= 1u << k;
    return mask;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bSmoothHomographies(const uint32_t *anchors, const Plx_Matrix33 *in, Plx_Vector3 *ref_points,
                                       double *ref_angles, uint32_t n, int32_t x_translation,
                                       int32_t y_translation, int32_t rotation, int32_t scale, int32_t shear,
                                       int32_t aspect, int32_t perspective_x, int32_t perspective_y,
                                       int32_t iterations, Plx_Matrix33 *out)
{
    if (n == 0) return 1;
    if (!given(__func__, in, out)) return 0;
    if (iterations < -1) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "iteration count below -1", iterations);
        return 0;
    }
    if (n == 1) {
        out[0] = in[0];
        return 1;
    }
    const int32_t flags[8] = {x_translation, y_translation, rotation, scale, shear, aspect, perspective_x, perspective_y};
    const uint32_t mask = component_mask(flags);
    const bool with_frames = ref_points != nullptr || ref_angles != nullptr;

    KeyFrames keys;
    if (!keys.make(anchors, n)) return 0;
    auto R = array<Plx_Matrix33>(n), Q = array<Plx_Matrix33>(n);
    if (R == nullptr || Q == nullptr) return 0;
    if (!reference_motion(in, n, keys, R.get())) return 0;
    for (uint32_t i = 0; i < n; ++i) {
        Plx_Matrix33 Rinv;
        if (!plx_mat33_invert_s(&R.get()[i], &Rinv)) return callee_failed();
        Q.get()[i] = product(in[i], Rinv);
    }
    plx::HeapPtr<Plx_Vector3> P;
    plx::HeapPtr<double> angle;
    if (with_frames) {
        P = array<Plx_Vector3>(n);
        angle = array<double>(n);
        if (P == nullptr || angle == nullptr) return 0;
        if (!reference_frames(Q.get(), n, keys, ref_points, ref_angles, P.get(), angle.get())) return 0;
    }

    // With everything stabilised, the residuals go entirely and the reference motion is the
    // answer; its anchor frames are the input itself, bit for bit.
    if (!(iterations == -1 && mask == kAllComponents)) {
        auto C = array<HomographyComponents>(n);
        if (C == nullptr) return 0;
        auto ref_angle = [&](uint32_t i) { return ref_angles != nullptr ? angle.get()[i] : 0.0; };
        for (uint32_t i = 0; i < n; ++i) {
            if (ref_points != nullptr) Q.get()[i] = product(Q.get()[i], translation(P.get()[i].x, P.get()[i].y));
            if (!bDecomposeHomography(&Q.get()[i], ref_angle(i), &C.get()[i])) return callee_failed();
        }
        HomographyComponents *c = C.get();
        if (iterations == -1 && keys.anchored) {
            between_keys(keys, n, [&](uint32_t i, uint32_t a, uint32_t b, double t) {
                bInterpolateComponents(&c[i], &c[a], &c[b], t, mask);
            });
        } else if (iterations == -1) {
            flatten_to_mean(c, n, mask);
        } else if (iterations > 0) {
            auto previous = array<HomographyComponents>(n);
            if (previous == nullptr) return 0;
            for (int32_t k = 0; k < iterations; ++k)
                if (!smooth_once(c, previous.get(), n, anchors, keys, mask)) return 0;
        }
        for (uint32_t i = 0; i < n; ++i) {
            Plx_Matrix33 S;
            bReconstructHomography(&c[i], ref_angle(i), &S);
            if (ref_points != nullptr) S = product(S, translation(-P.get()[i].x, -P.get()[i].y));
            R.get()[i] = product(S, R.get()[i]);
        }
    }
    if (ref_points != nullptr) std::memcpy(ref_points, P.get(), n * sizeof *ref_points);
    if (ref_angles != nullptr) std::memcpy(ref_angles, angle.get(), n * sizeof *ref_angles);
    std::memmove(out, R.get(), n * sizeof *out);
    return 1;
}

}  // extern "C"
