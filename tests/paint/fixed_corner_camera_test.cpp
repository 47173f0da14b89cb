// Fixed-corner-warp cameras (types 10 and 11): known displacements, fixed corners, round
// trips, derivatives, the Newton solve and its cache, failure codes, and the entry points
// that build, internalise, compare and convert.
#include <gtest/gtest.h>

#include "failure_check.hpp"

#include <cmath>
#include <cstddef>
#include <cstring>
#include <limits>
#include <random>
#include <vector>

#include "plano/plano.h"

namespace {

using plano_test::fails_with;

constexpr int kTypes[2] = {PLX_FIXED_CORNER_WARP_CAMERA, PLX_FIXED_CORNER_WARP_CAMERA_INV};

Plx_Camera make(int type, const double k[12], double fx = 1920, double fy = 1080, double x0 = 960,
                double y0 = 540, double zh = 1)
{
    Plx_Camera c;
    std::memset(&c, 0, sizeof c);
    EXPECT_TRUE(gbCameraBuildVA(&c, type, zh, fx, fy, x0, y0, k[0], k[1], k[2], k[3], k[4], k[5],
                                k[6], k[7], k[8], k[9], k[10], k[11]));
    return c;
}

Plx_Camera make_single(int type, int index, double value, double fx = 1920, double fy = 1080)
{
    double k[12] = {};
    k[index] = value;
    return make(type, k, fx, fy, fx / 2, fy / 2);
}

void random_coefficients(std::mt19937 &rng, double bound, double k[12])
{
    std::uniform_real_distribution<double> u(-bound, bound);
    for (int i = 0; i < 12; ++i) k[i] = u(rng);
}

int32_t origin_code()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.code : -1;
}


// Pixel of normalised (x, y) for a camera.
Plx_Vector3 pixel_of(const Plx_Camera &c, double x, double y) { return {x * c.fx + c.x0, y * c.fy + c.y0, c.zh}; }

// Every double field of the record, with its name, for numeric differentiation.
std::vector<std::pair<const char *, std::size_t>> camera_fields()
{
    static const char *const kNames[12] = {"k1", "k2", "k3", "k4", "k5", "k6", "k7", "k8", "k9", "k10", "k11", "k12"};
    std::vector<std::pair<const char *, std::size_t>> f = {
        {"fx", offsetof(Plx_Camera, fx)}, {"fy", offsetof(Plx_Camera, fy)}, {"skew", offsetof(Plx_Camera, skew)},
        {"x0", offsetof(Plx_Camera, x0)}, {"y0", offsetof(Plx_Camera, y0)}, {"zh", offsetof(Plx_Camera, zh)}};
    for (std::size_t i = 0; i < 12; ++i) f.emplace_back(kNames[i], offsetof(Plx_Camera, k) + i * sizeof(double));
    return f;
}
double &field(Plx_Camera &c, std::size_t offset) { return *reinterpret_cast<double *>(reinterpret_cast<char *>(&c) + offset); }

}  // namespace

TEST(FixedCornerCamera, EachCoefficientMovesItsEdgePoint)
{
    // k1..k8 move the edge midpoints by exactly their value (normalised units); k9..k12 bend
    // the centre lines: at a quarter of the way out the factor is 0.25 * (0.25 - 0.0625).
    struct Case {
        int index;
        double x, y, dx, dy;
    };
    const double k = 0.04, s = 0.25 * 0.1875 * k;
    const Case cases[] = {{0, -0.5, 0, 0, k},   {1, -0.5, 0, k, 0},   {2, 0.5, 0, 0, k},
                          {3, 0.5, 0, k, 0},    {4, 0, -0.5, k, 0},   {5, 0, -0.5, 0, k},
                          {6, 0, 0.5, k, 0},    {7, 0, 0.5, 0, k},    {8, 0.25, 0, s, 0},
                          {9, 0, 0.25, s, 0},   {10, 0.25, 0, 0, s},  {11, 0, 0.25, 0, s}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.index);
        // Type 10 projects through the warp; type 11 back-projects through it.
        Plx_Camera cam = make_single(PLX_FIXED_CORNER_WARP_CAMERA, c.index, k);
        Plx_Vector3 point{c.x, c.y, 1}, pixel;
        ASSERT_TRUE(gbPointProject(&cam, &point, &pixel, nullptr, nullptr, nullptr));
        EXPECT_NEAR(pixel.x, cam.x0 + (c.x + c.dx) * cam.fx, 1e-9);
        EXPECT_NEAR(pixel.y, cam.y0 + (c.y + c.dy) * cam.fy, 1e-9);
        EXPECT_EQ(pixel.z, cam.zh);

        Plx_Camera inv = make_single(PLX_FIXED_CORNER_WARP_CAMERA_INV, c.index, k);
        Plx_Vector3 edge = pixel_of(inv, c.x, c.y), ray;
        ASSERT_TRUE(inv.point_backproject(&inv, &edge, &ray, nullptr, nullptr));
        EXPECT_NEAR(ray.x, c.x + c.dx, 1e-12);
        EXPECT_NEAR(ray.y, c.y + c.dy, 1e-12);
        EXPECT_EQ(ray.z, 1.0);
    }
}

TEST(FixedCornerCamera, CornersStayAndZeroCoefficientsAreExact)
{
    std::mt19937 rng(7);
    for (int type : kTypes) {
        double k[12];
        random_coefficients(rng, 0.3, k);
        Plx_Camera cam = make(type, k);
        Plx_Camera_f camf;
        ASSERT_TRUE(gbCamerafFromCamera(&cam, &camf, nullptr, nullptr));
        for (double x : {-0.5, 0.5})
            for (double y : {-0.5, 0.5}) {
                Plx_Vector3 corner = pixel_of(cam, x, y), point{x, y, 1}, out;
                ASSERT_TRUE(cam.point_project(&cam, &point, &out, nullptr, nullptr, nullptr));
                EXPECT_EQ(out.x, corner.x);
                EXPECT_EQ(out.y, corner.y);
                ASSERT_TRUE(cam.point_backproject(&cam, &corner, &out, nullptr, nullptr));
                EXPECT_EQ(out.x, x);
                EXPECT_EQ(out.y, y);
                ASSERT_TRUE(cam.point_add_distortion(&cam, &corner, &out, nullptr, nullptr));
                EXPECT_EQ(out.x, corner.x);
                ASSERT_TRUE(cam.point_remove_distortion(&cam, &corner, &out, nullptr, nullptr));
                EXPECT_EQ(out.y, corner.y);
                Plx_Vector3_f cf{float(corner.x), float(corner.y), 1}, outf;
                ASSERT_TRUE(camf.point_backproject(&camf, &cf, &outf, nullptr, nullptr));
                EXPECT_EQ(outf.x, float(x));
                EXPECT_EQ(outf.y, float(y));
            }

        // All-zero coefficients: every operation is the pixel scaling and nothing more.
        const double zero[12] = {};
        Plx_Camera flat = make(type, zero, 2048, 1024, 1024, 512);
        Plx_Vector3 pixel{1500, 100, 1}, out;
        ASSERT_TRUE(flat.point_add_distortion(&flat, &pixel, &out, nullptr, nullptr));
        EXPECT_TRUE(out.x == 1500 && out.y == 100 && out.z == 1);
        ASSERT_TRUE(flat.point_remove_distortion(&flat, &pixel, &out, nullptr, nullptr));
        EXPECT_TRUE(out.x == 1500 && out.y == 100 && out.z == 1);
        ASSERT_TRUE(flat.point_backproject(&flat, &pixel, &out, nullptr, nullptr));
        EXPECT_TRUE(out.x == 476.0 / 2048 && out.y == -412.0 / 1024 && out.z == 1);
        Plx_Matrix22 J;
        Plx_Vector3 point{0.3, -0.2, 1};
        ASSERT_TRUE(flat.point_project(&flat, &point, &out, &J, nullptr, nullptr));
        EXPECT_TRUE(J.m[0][0] == 2048 && J.m[0][1] == 0 && J.m[1][0] == 0 && J.m[1][1] == 1024);
    }
}

TEST(FixedCornerCamera, ProjectionAndBackProjectionAreInverse)
{
    std::mt19937 rng(11);
    std::uniform_real_distribution<double> u(-0.6, 0.6), z(0.5, 4.0);
    for (int type : kTypes) {
        SCOPED_TRACE(type);
        double k[12];
        random_coefficients(rng, 0.05, k);
        Plx_Camera cam = make(type, k);
        Plx_Camera_f camf;
        ASSERT_TRUE(gbCamerafFromCamera(&cam, &camf, nullptr, nullptr));
        Plx_PositionState cache{};
        double worst = 0, worst_f = 0;
        for (int i = 0; i < 200; ++i) {
            double Z = z(rng);
            Plx_Vector3 point{u(rng) * Z, u(rng) * Z, Z}, pixel, ray, distorted, back;
            ASSERT_TRUE(cam.point_project(&cam, &point, &pixel, nullptr, nullptr, nullptr));
            ASSERT_TRUE(cam.point_backproject(&cam, &pixel, &ray, &cache, nullptr));
            worst = std::max({worst, std::fabs(ray.x - point.x / Z), std::fabs(ray.y - point.y / Z)});
            EXPECT_EQ(ray.z, 1.0);
            // Removing distortion and adding it back returns the pixel.
            ASSERT_TRUE(cam.point_remove_distortion(&cam, &pixel, &distorted, &cache, nullptr));
            ASSERT_TRUE(cam.point_add_distortion(&cam, &distorted, &back, &cache, nullptr));
            EXPECT_NEAR(back.x, pixel.x, 1e-7);
            EXPECT_NEAR(back.y, pixel.y, 1e-7);

            // The single-precision record agrees with the double one to float accuracy.
            Plx_Vector3_f pf{float(pixel.x), float(pixel.y), 1}, rf;
            ASSERT_TRUE(camf.point_backproject(&camf, &pf, &rf, nullptr, nullptr));
            worst_f = std::max({worst_f, std::fabs(rf.x - ray.x), std::fabs(rf.y - ray.y)});
        }
        EXPECT_LT(worst, 1e-9);
        EXPECT_LT(worst_f, 2e-6);
    }
}

TEST(FixedCornerCamera, DerivativesMatchCentralDifferences)
{
    std::mt19937 rng(5);
    for (int type : kTypes) {
        SCOPED_TRACE(type);
        double k[12];
        random_coefficients(rng, 0.05, k);
        Plx_Camera cam = make(type, k);
        for (Plx_Vector3 point : {Plx_Vector3{0.1, -0.2, 1}, Plx_Vector3{-0.9, 0.6, 2}}) {
            Plx_Vector3 pixel, plus, minus;
            Plx_Matrix22 J;
            Plx_Camera D[2];
            ASSERT_TRUE(cam.point_project(&cam, &point, &pixel, &J, D, nullptr));
            EXPECT_EQ(D[0].type, type);
            EXPECT_TRUE(D[1].point_project == nullptr);
            const double h = 1e-6;
            for (int c = 0; c < 2; ++c) {
                Plx_Vector3 p = point, m = point;
                (c == 0 ? p.x : p.y) += h * point.z;
                (c == 0 ? m.x : m.y) -= h * point.z;
                ASSERT_TRUE(cam.point_project(&cam, &p, &plus, nullptr, nullptr, nullptr));
                ASSERT_TRUE(cam.point_project(&cam, &m, &minus, nullptr, nullptr, nullptr));
                EXPECT_NEAR(J.m[0][c], (plus.x - minus.x) / (2 * h), 1e-4);
                EXPECT_NEAR(J.m[1][c], (plus.y - minus.y) / (2 * h), 1e-4);
            }
            for (const auto &[name, offset] : camera_fields()) {
                SCOPED_TRACE(name);
                Plx_Camera p = cam, m = cam;
                double step = h * std::max(1.0, std::fabs(field(cam, offset)));
                field(p, offset) += step;
                field(m, offset) -= step;
                ASSERT_TRUE(cam.point_project(&p, &point, &plus, nullptr, nullptr, nullptr));
                ASSERT_TRUE(cam.point_project(&m, &point, &minus, nullptr, nullptr, nullptr));
                EXPECT_NEAR(field(D[0], offset), (plus.x - minus.x) / (2 * step), 1e-4);
                EXPECT_NEAR(field(D[1], offset), (plus.y - minus.y) / (2 * step), 1e-4);
            }
        }
    }
}

TEST(FixedCornerCamera, NewtonSolveUsesAndFillsTheCache)
{
    // With only k9 = -8 the warp along the centre row is x' = 8x^3 - x, which sends x = 0 and
    // x = 1/sqrt(8) alike to 0: the root found depends on where the solve starts.
    Plx_Camera cam = make_single(PLX_FIXED_CORNER_WARP_CAMERA, 8, -8.0, 1000, 1000);
    const Plx_Vector3 centre{500, 500, 1};
    Plx_Vector3 ray;
    Plx_PositionState cache{};
    ASSERT_TRUE(gbPointBackproject(&cam, &centre, &ray, &cache, nullptr));
    EXPECT_EQ(ray.x, 0.0);
    EXPECT_EQ(cache.valid, 1);
    EXPECT_TRUE(cache.point[0] == 500 && cache.point[1] == 500 && cache.point[2] == 1);
    EXPECT_TRUE(cache.solution[0] == 0 && cache.solution[1] == 0 && cache.solution[2] == 1);

    cache.solution[0] = 0.36;
    ASSERT_TRUE(gbPointBackproject(&cam, &centre, &ray, &cache, nullptr));
    EXPECT_NEAR(ray.x, 1 / std::sqrt(8.0), 1e-12);
    EXPECT_EQ(cache.solution[0], ray.x);

    cache.valid = 0;  // an empty cache is not read
    ASSERT_TRUE(gbPointBackproject(&cam, &centre, &ray, &cache, nullptr));
    EXPECT_EQ(ray.x, 0.0);

    cache.solution[0] = std::numeric_limits<double>::quiet_NaN();  // a failing start is retried
    ASSERT_TRUE(gbPointRemoveDistortion(&cam, &centre, &ray, &cache, nullptr));
    EXPECT_EQ(ray.x, 500.0);
    EXPECT_EQ(cache.solution[0], 0.0);

    // k9 = -5.5: from its default start the solve at x' = 1/16 never settles (code 27), but a
    // start near the root x ~ 0.32 converges.
    Plx_Camera wild = make_single(PLX_FIXED_CORNER_WARP_CAMERA, 8, -5.5, 1000, 1000);
    const Plx_Vector3 pixel{562.5, 500, 1};
    int32_t code = 0;
    EXPECT_FALSE(gbPointBackproject(&wild, &pixel, &ray, nullptr, &code));
    EXPECT_EQ(code, PLX_ERROR_OUTSIDE_RANGE);
    cache = Plx_PositionState{1, {0, 0, 0}, {0.32, 0, 1}};
    ASSERT_TRUE(gbPointBackproject(&wild, &pixel, &ray, &cache, nullptr));
    Plx_Vector3 again;
    ASSERT_TRUE(gbPointProject(&wild, &ray, &again, nullptr, nullptr, nullptr));
    EXPECT_NEAR(again.x, 562.5, 1e-9);
}

TEST(FixedCornerCamera, FailuresReportTheirCodes)
{
    double k[12];
    std::mt19937 rng(3);
    random_coefficients(rng, 0.05, k);
    for (int type : kTypes) {
        SCOPED_TRACE(type);
        Plx_Camera cam = make(type, k);
        const Plx_Vector3 good{100, 200, 1}, at_infinity{100, 200, 0}, on_plane{1, 2, 0};
        Plx_Vector3 out{7, 7, 7};

        EXPECT_FALSE(cam.point_project(&cam, &on_plane, &out, nullptr, nullptr, nullptr));
        EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);
        EXPECT_FALSE(cam.point_backproject(&cam, &at_infinity, &out, nullptr, nullptr));
        EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);
        EXPECT_FALSE(cam.point_add_distortion(&cam, &at_infinity, &out, nullptr, nullptr));
        EXPECT_FALSE(cam.point_backproject(&cam, &good, nullptr, nullptr, nullptr));
        EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
        Plx_Camera flat_h = cam;
        flat_h.zh = 0;
        EXPECT_FALSE(cam.point_remove_distortion(&flat_h, &good, &out, nullptr, nullptr));
        EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);
        Plx_Camera other = cam;
        other.type = PLX_RADIAL_CAMERA_1;
        EXPECT_TRUE(fails_with(gbPointBackproject(&other, &good, &out, nullptr, nullptr), PLX_ERROR_ILLEGAL_TYPE));
        EXPECT_TRUE(out.x == 7 && out.y == 7 && out.z == 7);  // failures leave the output alone

        // Lines bend: both operations are unsupported, projection checks its divisors first.
        EXPECT_TRUE(fails_with(cam.line_project(&cam, &good, &out, nullptr), PLX_ERROR_UNSUPPORTED));
        EXPECT_TRUE(fails_with(cam.line_project(&flat_h, &good, &out, nullptr), PLX_ERROR_DIVISION_BY_ZERO));
        EXPECT_TRUE(fails_with(cam.line_backproject(&cam, &good, &out, nullptr), PLX_ERROR_UNSUPPORTED));

        // With a slot the code goes there and the caller's trace stays as it was; success
        // leaves the slot alone.
        plx_err_flush_trace();
        plx_err_register_fileline("caller", 99, "here", 1, "kept", 0);
        int32_t code = -5;
        ASSERT_TRUE(cam.point_backproject(&cam, &good, &out, nullptr, &code));
        EXPECT_EQ(code, -5);
        EXPECT_FALSE(cam.point_backproject(&cam, &at_infinity, &out, nullptr, &code));
        EXPECT_EQ(code, PLX_ERROR_DIVISION_BY_ZERO);
        EXPECT_FALSE(cam.line_backproject(&cam, &good, &out, &code));
        EXPECT_EQ(code, PLX_ERROR_UNSUPPORTED);
        Plx_ErrorRecord r;
        ASSERT_EQ(plx_err_get_error_count(), 1u);
        ASSERT_TRUE(plx_err_get_error(0, &r));
        EXPECT_STREQ(r.function, "caller");
    }

    // A singular warp Jacobian at the start: k9 = -4 flattens x' = 4x^3 at the centre.
    Plx_Camera flat = make_single(PLX_FIXED_CORNER_WARP_CAMERA, 8, -4.0, 1000, 1000);
    const Plx_Vector3 centre{500, 500, 1};
    Plx_Vector3 out;
    EXPECT_FALSE(flat.point_backproject(&flat, &centre, &out, nullptr, nullptr));
    Plx_ErrorRecord r;
    ASSERT_TRUE(plx_err_get_error(0, &r));
    EXPECT_EQ(r.code, PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_STREQ(r.function, "gbPointBackproject");
    // The single-precision twin reports under the same name.
    Plx_Camera_f flat_f;
    ASSERT_TRUE(gbCamerafFromCamera(&flat, &flat_f, nullptr, nullptr));
    const Plx_Vector3_f centre_f{500, 500, 1};
    Plx_Vector3_f out_f;
    EXPECT_FALSE(flat_f.point_backproject(&flat_f, &centre_f, &out_f, nullptr, nullptr));
    ASSERT_TRUE(plx_err_get_error(0, &r));
    EXPECT_STREQ(r.function, "gbPointBackproject");
}

TEST(FixedCornerCamera, BuildersAndInternalize)
{
    const double k[12] = {0.01, -0.02, 0.03, 0, 0, 0.01, 0, 0, 0.1, 0, 0, -0.1};
    Plx_Camera cam = make(PLX_FIXED_CORNER_WARP_CAMERA, k);
    EXPECT_TRUE(cam.point_project == &gbPointProject);
    EXPECT_TRUE(cam.line_backproject == &gbLineBackproject);

    Plx_Camera untouched;
    std::memcpy(&untouched, &cam, sizeof cam);
    EXPECT_FALSE(gbCameraBuildVA(&untouched, PLX_RADIAL_CAMERA_1, 1.0, 100.0, 100.0, 50.0, 50.0, 0.1));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_TYPE);
    EXPECT_FALSE(gbCameraBuildVA(&untouched, PLX_FIXED_CORNER_WARP_CAMERA, 1.0, 0.0, 100.0, 50.0, 50.0,
                                 0., 0., 0., 0., 0., 0., 0., 0., 0., 0., 0., 0.));
    EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);  // the common fields' check
    EXPECT_FALSE(gbCameraBuildVA(&untouched, PLX_FIXED_CORNER_WARP_CAMERA, 1.0, 10.0, 100.0, 50.0, 50.0,
                                 0., 0., 0., 0., 0., 0., 0., 0., 0., 0., 0., std::nan("")));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(std::memcmp(&untouched, &cam, sizeof cam), 0);

    // A record copied without its operations gets them back; the unread skew survives.
    Plx_Camera copy;
    std::memcpy(&copy, &cam, sizeof copy);
    copy.skew = 3;
    copy.point_project = nullptr;
    copy.point_backproject = nullptr;
    ASSERT_TRUE(gbCameraInternalize(&copy));
    EXPECT_TRUE(copy.point_backproject == &gbPointBackproject);
    EXPECT_EQ(copy.skew, 3.0);
    // Other types go to the numerical layer, which refuses what it does not know.
    Plx_Camera linear;
    ASSERT_TRUE(plx_camera_build_linear(&linear, 1, 100, 100, 50, 50));
    linear.point_project = nullptr;
    ASSERT_TRUE(gbCameraInternalize(&linear));
    EXPECT_TRUE(linear.point_project != nullptr);
    linear.type = 99;
    EXPECT_TRUE(fails_with(gbCameraInternalize(&linear), PLX_ERROR_ILLEGAL_TYPE));

    // The single-precision builders match the conversion of the double record.
    Plx_Camera_f built, converted;
    ASSERT_TRUE(gbCameraBuildFixedCornerWarpInv_f(&built, 1, 1920, 1080, 960, 540, 0.01f, -0.02f, 0.03f,
                                                  0, 0, 0.01f, 0, 0, 0.1f, 0, 0, -0.1f));
    Plx_Camera inv = make(PLX_FIXED_CORNER_WARP_CAMERA_INV, k);
    ASSERT_TRUE(gbCamerafFromCamera(&inv, &converted, nullptr, nullptr));
    EXPECT_TRUE(gbCameraIdentical_f(&built, &converted));
    ASSERT_TRUE(gbCameraBuildFixedCornerWarp_f(&built, 1, 1920, 1080, 960, 540, 0.01f, -0.02f, 0.03f, 0,
                                               0, 0.01f, 0, 0, 0.1f, 0, 0, -0.1f));
    EXPECT_EQ(built.type, PLX_FIXED_CORNER_WARP_CAMERA);
}

TEST(FixedCornerCamera, IdenticalAndConversions)
{
    // Coefficients that float holds exactly, so the round trip through float is lossless.
    const double k[12] = {0.015625, -0.03125, 0.0078125, 0, 0.25, 0, 0, -0.5, 0.125, 0, 0, 0.0625};
    Plx_Camera a = make(PLX_FIXED_CORNER_WARP_CAMERA, k), b = a;
    b.skew = 42;  // never compared
    EXPECT_TRUE(gbCameraIdentical(&a, &b));
    b.k[11] = 0.0;
    EXPECT_FALSE(gbCameraIdentical(&a, &b));
    b = a;
    b.k[3] = std::nan("");
    EXPECT_FALSE(gbCameraIdentical(&b, &b));

    plx_err_flush_trace();
    Plx_Camera inv = make(PLX_FIXED_CORNER_WARP_CAMERA_INV, k);
    EXPECT_FALSE(gbCameraIdentical(&a, &inv));
    EXPECT_EQ(plx_err_get_error_count(), 0u);
    Plx_Camera radial;
    ASSERT_TRUE(plx_camera_build_radial_1(&radial, 1, 100, 100, 50, 50, 0.1));
    EXPECT_TRUE(fails_with(gbCameraIdentical(&radial, &radial), PLX_ERROR_ILLEGAL_TYPE));

    // Double -> float -> double keeps every field and clears the callers' caches.
    Plx_PositionState ca{}, cb{};
    ca.valid = cb.valid = 1;
    Plx_Camera_f f = gcfCamerafFromCamera(&inv, &ca, &cb);
    EXPECT_EQ(ca.valid, 0);
    EXPECT_EQ(cb.valid, 0);
    EXPECT_EQ(f.type, PLX_FIXED_CORNER_WARP_CAMERA_INV);
    Plx_Camera back = gcCameraFromCameraf(&f, nullptr, nullptr);
    EXPECT_TRUE(gbCameraIdentical(&back, &inv));
    EXPECT_TRUE(back.point_project == &gbPointProject);

    // Other types through the numerical layer.
    Plx_Camera_f radial_f;
    ASSERT_TRUE(gbCamerafFromCamera(&radial, &radial_f, nullptr, nullptr));
    EXPECT_EQ(radial_f.type, PLX_RADIAL_CAMERA_1);
    EXPECT_FLOAT_EQ(radial_f.k[0], 0.1f);

    // Failures: the by-value forms add code 1 and return an empty record.
    Plx_Camera_f empty = gcfCamerafFromCamera(nullptr, nullptr, nullptr);
    EXPECT_TRUE(empty.point_project == nullptr);
    Plx_ErrorRecord r;
    ASSERT_EQ(plx_err_get_error_count(), 2u);
    ASSERT_TRUE(plx_err_get_error(1, &r));
    EXPECT_EQ(r.code, PLX_ERROR_CALLEE);
    EXPECT_STREQ(r.function, "gcfCamerafFromCamera");
    Plx_Camera huge = a;
    huge.fx = 1e300;
    EXPECT_TRUE(fails_with(gbCamerafFromCamera(&huge, &f, nullptr, nullptr), PLX_ERROR_OUTSIDE_RANGE));
}
