// Cameras: known projections, round trips of every kind in both precisions, Jacobians and
// parameter derivatives against central differences, lines, caches, records rebuilt from
// their fields, and the failure codes.
#include <gtest/gtest.h>

#include "failure_check.hpp"

#include <cmath>
#include <cstring>
#include <string>
#include <vector>

#include "pellux/pellux.h"

namespace {

using plano_test::fails_with;

int32_t origin_code()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.code : 0;
}


struct Kind {
    const char *name;
    int32_t type;
    std::vector<double> coeffs;  // as build_va takes them
};

// Realistic lens strengths: the distorted kinds move the image corners by tens of pixels.
const std::vector<Kind> &kinds()
{
    static const std::vector<Kind> all{
        {"linear", PLX_LINEAR_CAMERA, {}},
        {"affine", PLX_AFFINE_CAMERA, {3.0}},
        {"radial1", PLX_RADIAL_CAMERA_1, {-0.2}},
        {"radial2", PLX_RADIAL_CAMERA_2, {-0.2, 0.05}},
        {"radial3", PLX_RADIAL_CAMERA_3, {-0.2, 0.05, -0.01}},
        {"inv_radial", PLX_INV_RADIAL_CAMERA, {0.15}},
        {"xy", PLX_XY_DISTORTION_CAMERA, {0.05, -0.03, 0.04, -0.02}},
    };
    return all;
}

constexpr double kZh = 2.0, kFx = 800.0, kFy = 780.0, kX0 = 320.0, kY0 = 240.0;

Plx_Camera make(const Kind &k, double zh = kZh)
{
    Plx_Camera c;
    std::memset(&c, 0, sizeof c);
    double a[4] = {0, 0, 0, 0};
    for (size_t i = 0; i < k.coeffs.size(); ++i) a[i] = k.coeffs[i];
    EXPECT_TRUE(plx_camera_build_va(&c, k.type, zh, kFx, kFy, kX0, kY0, a[0], a[1], a[2], a[3])) << k.name;
    return c;
}

Plx_Camera_f make_f(const Kind &k)
{
    Plx_Camera_f c;
    std::memset(&c, 0, sizeof c);
    double a[4] = {0, 0, 0, 0};
    for (size_t i = 0; i < k.coeffs.size(); ++i) a[i] = k.coeffs[i];
    EXPECT_TRUE(plx_cameraf_build_va(&c, k.type, kZh, kFx, kFy, kX0, kY0, a[0], a[1], a[2], a[3])) << k.name;
    return c;
}

// Normalised points over most of the frame, at several depths.
std::vector<Plx_Vector3> scene_points()
{
    std::vector<Plx_Vector3> out;
    for (double y = -0.36; y <= 0.37; y += 0.18)
        for (double x = -0.48; x <= 0.49; x += 0.16)
            for (double z : {1.0, 3.5}) out.push_back({x * z, y * z, z});
    return out;
}

Plx_Vector3 project(const Plx_Camera &c, Plx_Vector3 p)
{
    Plx_Vector3 q{};
    EXPECT_TRUE(c.point_project(&c, &p, &q, nullptr, nullptr, nullptr));
    return q;
}

// Pointers to the fields a parameter derivative reports, in record order.
std::vector<double *> fields(Plx_Camera &c)
{
    std::vector<double *> f{&c.fx, &c.fy, &c.skew, &c.x0, &c.y0, &c.zh};
    for (double &k : c.k) f.push_back(&k);
    return f;
}

}  // namespace

TEST(Camera, KnownProjectionsOfEachKind)
{
    // Worked by hand: normalised (0.5, -0.25) at depth 2, fx 100, fy 200, centre (10, 20).
    Plx_Camera c;
    Plx_Vector3 p{1.0, -0.5, 2.0}, q;
    ASSERT_TRUE(plx_camera_build_linear(&c, 1.0, 100, 200, 10, 20));
    ASSERT_TRUE(plx_camera_project_point(&c, &p, &q));
    EXPECT_DOUBLE_EQ(q.x, 60.0);
    EXPECT_DOUBLE_EQ(q.y, -30.0);
    EXPECT_DOUBLE_EQ(q.z, 1.0);

    // Affine: no division by Z; skew 4 adds 4*y.
    ASSERT_TRUE(plx_camera_build_affine(&c, 1.0, 100, 200, 4, 10, 20));
    ASSERT_TRUE(plx_camera_project_point(&c, &p, &q));
    EXPECT_DOUBLE_EQ(q.x, 100 * 1.0 + 4 * -0.5 + 10);
    EXPECT_DOUBLE_EQ(q.y, 200 * -0.5 + 20);

    // r^2 = 0.3125: d = 1 + 0.1 r^2 + 0.01 r^4 + 0.001 r^6.
    double r2 = 0.3125, d = 1 + 0.1 * r2 + 0.01 * r2 * r2 + 0.001 * r2 * r2 * r2;
    ASSERT_TRUE(plx_camera_build_radial_3(&c, 1.0, 100, 200, 10, 20, 0.1, 0.01, 0.001));
    ASSERT_TRUE(plx_camera_project_point(&c, &p, &q));
    EXPECT_NEAR(q.x, 100 * 0.5 * d + 10, 1e-12);
    EXPECT_NEAR(q.y, 200 * -0.25 * d + 20, 1e-12);

    // x/y: x (1 + cxx x^2 + cxy y^2), y (1 + cyx x^2 + cyy y^2).
    ASSERT_TRUE(plx_camera_build_xy_distortion(&c, 1.0, 100, 200, 10, 20, 0.1, 0.2, 0.3, 0.4));
    ASSERT_TRUE(plx_camera_project_point(&c, &p, &q));
    EXPECT_NEAR(q.x, 100 * 0.5 * (1 + 0.1 * 0.25 + 0.2 * 0.0625) + 10, 1e-12);
    EXPECT_NEAR(q.y, 200 * -0.25 * (1 + 0.3 * 0.25 + 0.4 * 0.0625) + 20, 1e-12);

    // Inverse radial: removing distortion is the closed form, so back-projection of the
    // pixel of normalised (0.5, -0.25) multiplies by 1 + K1 r^2.
    ASSERT_TRUE(plx_camera_build_inv_radial(&c, 1.0, 100, 200, 10, 20, 0.2));
    Plx_Vector3 pixel{100 * 0.5 + 10, 200 * -0.25 + 20, 1.0};
    ASSERT_TRUE(plx_camera_backproject_point(&c, &pixel, &q));
    EXPECT_NEAR(q.x, 0.5 * (1 + 0.2 * r2), 1e-12);
    EXPECT_NEAR(q.y, -0.25 * (1 + 0.2 * r2), 1e-12);
    EXPECT_EQ(q.z, 1.0);

    Plx_Matrix33 M;
    ASSERT_TRUE(plx_camera_build_affine(&c, 2.0, 100, 200, 4, 10, 20));
    plx_camera_fill_fullmatrix_s(&c, &M);
    const double full[3][3] = {{100, 4, 10}, {0, 200, 20}, {0, 0, 2}};
    EXPECT_EQ(std::memcmp(M.m, full, sizeof full), 0);
    plx_camera_fill_matrix_s(&c, &M);
    const double no_skew[3][3] = {{100, 0, 10}, {0, 200, 20}, {0, 0, 2}};
    EXPECT_EQ(std::memcmp(M.m, no_skew, sizeof no_skew), 0);
}

TEST(Camera, HomogeneousPixelsFollowTheCamerasZh)
{
    for (const Kind &k : kinds()) {
        Plx_Camera c = make(k);
        Plx_Vector3 pixel = project(c, {0.3, -0.2, 1.0});
        EXPECT_EQ(pixel.z, kZh) << k.name;
        // (u, v, w) stands for (zh u / w, zh v / w): any multiple is the same pixel.
        Plx_Vector3 scaled{pixel.x * 3.0, pixel.y * 3.0, pixel.z * 3.0}, a, b;
        ASSERT_TRUE(plx_camera_backproject_point(&c, &pixel, &a)) << k.name;
        ASSERT_TRUE(plx_camera_backproject_point(&c, &scaled, &b)) << k.name;
        EXPECT_NEAR(a.x, b.x, 1e-12) << k.name;
        EXPECT_NEAR(a.y, b.y, 1e-12) << k.name;
        ASSERT_TRUE(plx_camera_remove_distortion(&c, &scaled, &b)) << k.name;
        EXPECT_EQ(b.z, kZh) << k.name;
    }
    // Affine ignores depth; the others divide by it.
    Plx_Camera affine = make(kinds()[1]);
    Plx_Vector3 near = project(affine, {0.3, -0.2, 1.0}), far = project(affine, {0.3, -0.2, 5.0});
    EXPECT_EQ(near.x, far.x);
    Plx_Camera linear = make(kinds()[0]);
    near = project(linear, {0.3, -0.2, 1.0});
    far = project(linear, {1.5, -1.0, 5.0});
    EXPECT_NEAR(near.x, far.x, 1e-12);
}

TEST(Camera, EveryKindRoundTripsPointsInBothPrecisions)
{
    for (const Kind &k : kinds()) {
        Plx_Camera c = make(k);
        Plx_Camera_f cf = make_f(k);
        for (const Plx_Vector3 &p : scene_points()) {
            const bool affine = k.type == PLX_AFFINE_CAMERA;
            double x = affine ? p.x : p.x / p.z, y = affine ? p.y : p.y / p.z;
            Plx_Vector3 pixel = project(c, p), back, distorted, undistorted;
            ASSERT_TRUE(c.point_backproject(&c, &pixel, &back, nullptr, nullptr)) << k.name;
            EXPECT_NEAR(back.x, x, 1e-10) << k.name;
            EXPECT_NEAR(back.y, y, 1e-10) << k.name;
            EXPECT_EQ(back.z, 1.0);

            // Distortion of a pixel and its removal are inverse, in both orders.
            ASSERT_TRUE(c.point_add_distortion(&c, &pixel, &distorted, nullptr, nullptr)) << k.name;
            ASSERT_TRUE(c.point_remove_distortion(&c, &distorted, &undistorted, nullptr, nullptr)) << k.name;
            EXPECT_NEAR(undistorted.x, pixel.x, 1e-7) << k.name;
            EXPECT_NEAR(undistorted.y, pixel.y, 1e-7) << k.name;
            ASSERT_TRUE(c.point_remove_distortion(&c, &pixel, &undistorted, nullptr, nullptr)) << k.name;
            ASSERT_TRUE(c.point_add_distortion(&c, &undistorted, &distorted, nullptr, nullptr)) << k.name;
            EXPECT_NEAR(distorted.x, pixel.x, 1e-7) << k.name;
            EXPECT_NEAR(distorted.y, pixel.y, 1e-7) << k.name;
            // Projection is the linear part after adding distortion.
            Plx_Vector3 linear_pixel{kFx * x + c.skew * y + kX0, kFy * y + kY0, kZh};
            ASSERT_TRUE(c.point_add_distortion(&c, &linear_pixel, &distorted, nullptr, nullptr)) << k.name;
            EXPECT_NEAR(distorted.x, pixel.x, 1e-7) << k.name;
            EXPECT_NEAR(distorted.y, pixel.y, 1e-7) << k.name;

            // Single precision agrees with double to float accuracy, and round-trips too.
            Plx_Vector3_f pf{static_cast<float>(p.x), static_cast<float>(p.y), static_cast<float>(p.z)}, qf, bf;
            ASSERT_TRUE(plx_cameraf_project_point(&cf, &pf, &qf)) << k.name;
            EXPECT_NEAR(qf.x, pixel.x, 2e-3) << k.name;
            EXPECT_NEAR(qf.y, pixel.y, 2e-3) << k.name;
            EXPECT_EQ(qf.z, static_cast<float>(kZh));
            ASSERT_TRUE(plx_cameraf_backproject_point(&cf, &qf, &bf)) << k.name;
            EXPECT_NEAR(bf.x, x, 2e-6) << k.name;
            EXPECT_NEAR(bf.y, y, 2e-6) << k.name;
        }
    }
}

TEST(Camera, JacobiansAndParameterDerivativesMatchCentralDifferences)
{
    for (const Kind &k : kinds()) {
        Plx_Camera c = make(k);
        if (k.type != PLX_AFFINE_CAMERA) c.skew = 1.5;  // exercised by every type's linear part
        for (const Plx_Vector3 &p : scene_points()) {
            if (p.z != 1.0) continue;
            Plx_Matrix22 J;
            Plx_Camera deriv[2];
            Plx_Vector3 q;
            ASSERT_TRUE(c.point_project(&c, &p, &q, &J, deriv, nullptr)) << k.name;
            EXPECT_EQ(deriv[0].type, k.type);
            EXPECT_EQ(deriv[1].point_project, nullptr);

            const double h = 1e-6;
            for (int axis = 0; axis < 2; ++axis) {
                Plx_Vector3 lo = p, hi = p;
                (axis == 0 ? lo.x : lo.y) -= h;
                (axis == 0 ? hi.x : hi.y) += h;
                Plx_Vector3 a = project(c, lo), b = project(c, hi);
                EXPECT_NEAR(J.m[0][axis], (b.x - a.x) / (2 * h), 1e-6 * kFx) << k.name << " du/d" << axis;
                EXPECT_NEAR(J.m[1][axis], (b.y - a.y) / (2 * h), 1e-6 * kFx) << k.name << " dv/d" << axis;
            }
            // Each field perturbed in a copy whose operations are re-installed.
            Plx_Camera base = c;
            std::vector<double *> f = fields(base);
            std::vector<double *> du = fields(deriv[0]), dv = fields(deriv[1]);
            for (size_t i = 0; i < f.size(); ++i) {
                double step = std::fabs(*f[i]) > 1 ? 1e-6 * std::fabs(*f[i]) : 1e-6;
                double saved = *f[i];
                *f[i] = saved - step;
                ASSERT_TRUE(plx_camera_internalize(&base));
                Plx_Vector3 a = project(base, p);
                *f[i] = saved + step;
                ASSERT_TRUE(plx_camera_internalize(&base));
                Plx_Vector3 b = project(base, p);
                *f[i] = saved;
                EXPECT_NEAR(*du[i], (b.x - a.x) / (2 * step), 1e-5 * (1 + std::fabs(*du[i]))) << k.name << " field " << i;
                EXPECT_NEAR(*dv[i], (b.y - a.y) / (2 * step), 1e-5 * (1 + std::fabs(*dv[i]))) << k.name << " field " << i;
            }
        }
    }
}

TEST(Camera, LinesMapExactlyThroughLinearCamerasOnly)
{
    for (const Kind &k : kinds()) {
        Plx_Camera c = make(k);
        // The line through normalised (0.1, 0.2) and (-0.3, 0.05) is their cross product.
        Plx_Vector3 a{0.1, 0.2, 1}, b{-0.3, 0.05, 1};
        Plx_Vector3 line{a.y * b.z - a.z * b.y, a.z * b.x - a.x * b.z, a.x * b.y - a.y * b.x}, image_line, back;
        if (k.type != PLX_LINEAR_CAMERA && k.type != PLX_AFFINE_CAMERA) {
            EXPECT_TRUE(fails_with(plx_camera_project_line(&c, &line, &image_line), PLX_ERROR_UNSUPPORTED)) << k.name;
            int32_t code = 0;
            EXPECT_FALSE(c.line_backproject(&c, &line, &back, &code));
            EXPECT_EQ(code, PLX_ERROR_UNSUPPORTED);
            continue;
        }
        ASSERT_TRUE(plx_camera_project_line(&c, &line, &image_line)) << k.name;
        for (const Plx_Vector3 &p : {a, b, Plx_Vector3{0.1 + 4 * (-0.4), 0.2 + 4 * (-0.15), 1}}) {
            Plx_Vector3 pixel = project(c, p);
            double scale = std::fabs(image_line.x * pixel.x) + std::fabs(image_line.y * pixel.y) + std::fabs(image_line.z * pixel.z);
            EXPECT_NEAR(image_line.x * pixel.x + image_line.y * pixel.y + image_line.z * pixel.z, 0.0, 1e-12 * scale) << k.name;
        }
        ASSERT_TRUE(plx_camera_backproject_line(&c, &image_line, &back)) << k.name;
        EXPECT_NEAR(back.x, line.x, 1e-14);
        EXPECT_NEAR(back.y, line.y, 1e-14);
        EXPECT_NEAR(back.z, line.z, 1e-14);
    }
    Plx_Camera c = make(kinds()[2]);
    c.fx = 0;
    Plx_Vector3 l{1, 2, 3}, out;
    int32_t code = 0;
    EXPECT_FALSE(c.line_project(&c, &l, &out, &code));
    EXPECT_EQ(code, PLX_ERROR_DIVISION_BY_ZERO);
}

TEST(Camera, CacheStartsTheSolveAndBadCachesAreHarmless)
{
    Plx_Camera c = make(kinds()[4]);  // radial3: removal needs the solve
    Plx_Vector3 pixel = project(c, {0.4, -0.3, 1}), plain, cached;
    ASSERT_TRUE(c.point_backproject(&c, &pixel, &plain, nullptr, nullptr));
    Plx_PositionState cache{};
    ASSERT_TRUE(c.point_backproject(&c, &pixel, &cached, &cache, nullptr));
    EXPECT_EQ(cache.valid, 1);
    EXPECT_EQ(cache.point[0], pixel.x);
    EXPECT_EQ(cache.point[2], pixel.z);
    EXPECT_NEAR(cache.solution[0], plain.x, 1e-12);
    EXPECT_EQ(cache.solution[2], 1.0);

    // A neighbouring pixel starts from the cached solution and reaches the same answer.
    Plx_Vector3 next{pixel.x + 1.5, pixel.y - 0.5, pixel.z};
    ASSERT_TRUE(c.point_backproject(&c, &next, &plain, nullptr, nullptr));
    ASSERT_TRUE(c.point_backproject(&c, &next, &cached, &cache, nullptr));
    EXPECT_NEAR(cached.x, plain.x, 1e-12);
    EXPECT_NEAR(cached.y, plain.y, 1e-12);

    // A start that cannot converge falls back to the default start.
    cache.solution[0] = std::nan("");
    ASSERT_TRUE(c.point_remove_distortion(&c, &next, &cached, &cache, nullptr));
    Plx_Vector3 expected;
    ASSERT_TRUE(plx_camera_remove_distortion(&c, &next, &expected));
    EXPECT_NEAR(cached.x, expected.x, 1e-9);
    EXPECT_TRUE(std::isfinite(cache.solution[0]));

    // Inverse radial adds distortion by the solve: the cache serves projection too.
    Plx_Camera inv = make(kinds()[5]);
    Plx_PositionState inv_cache{};
    Plx_Vector3 undistorted{500, 100, kZh}, distorted, back;
    ASSERT_TRUE(inv.point_add_distortion(&inv, &undistorted, &distorted, &inv_cache, nullptr));
    EXPECT_EQ(inv_cache.valid, 1);
    ASSERT_TRUE(inv.point_remove_distortion(&inv, &distorted, &back, nullptr, nullptr));
    EXPECT_NEAR(back.x, 500, 1e-8);
}

TEST(Camera, SolvesBeyondTheLensRangeFailWithCode27)
{
    // x (1 - 0.5 r^2) never exceeds 0.544 on the x axis: nothing distorts to x = 0.9.
    Plx_Camera c;
    ASSERT_TRUE(plx_camera_build_radial_1(&c, 1.0, 100, 100, 0, 0, -0.5));
    Plx_Vector3 pixel{90, 0, 1}, out{7, 7, 7};
    int32_t code = 0;
    EXPECT_FALSE(c.point_backproject(&c, &pixel, &out, nullptr, &code));
    // The cubic has a root near x = -1.8, beyond the fold of the lens: it must not be taken.
    EXPECT_EQ(code, PLX_ERROR_OUTSIDE_RANGE);
    EXPECT_EQ(out.x, 7);  // outputs untouched on failure
    EXPECT_TRUE(fails_with(plx_camera_remove_distortion(&c, &pixel, &out), code));
}

TEST(Camera, ErrorSlotOrTraceAndZeroDivisors)
{
    Plx_Camera c = make(kinds()[2]);
    Plx_Vector3 behind{1, 1, 0}, pixel_at_infinity{1, 1, 0}, out;

    // With a slot the trace keeps what it had.
    plx_err_flush_trace();
    plx_err_register_fileline("sentinel", 99, "here", 1, "", 0);
    int32_t code = 0;
    EXPECT_FALSE(c.point_project(&c, &behind, &out, nullptr, nullptr, &code));
    EXPECT_EQ(code, PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_FALSE(c.point_add_distortion(&c, &pixel_at_infinity, &out, nullptr, &code));
    EXPECT_EQ(code, PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_FALSE(c.point_project(&c, nullptr, &out, nullptr, nullptr, &code));
    EXPECT_EQ(code, PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_EQ(plx_err_get_error_count(), 1u);
    EXPECT_EQ(origin_code(), 99);

    // Without one the failure starts a new trace; a wrapper adds its code-1 record.
    EXPECT_FALSE(plx_camera_backproject_point(&c, &pixel_at_infinity, &out));
    ASSERT_EQ(plx_err_get_error_count(), 2u);
    Plx_ErrorRecord r;
    ASSERT_TRUE(plx_err_get_error(0, &r));
    EXPECT_EQ(r.code, PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_STREQ(r.function, "plx_camera_point_backproject");
    ASSERT_TRUE(plx_err_get_error(1, &r));
    EXPECT_EQ(r.code, PLX_ERROR_CALLEE);
    EXPECT_STREQ(r.function, "plx_camera_backproject_point");

    EXPECT_TRUE(fails_with(plx_camera_project_point(nullptr, &behind, &out), PLX_ERROR_NOT_INITIALISED));
    Plx_Camera empty{};
    EXPECT_TRUE(fails_with(plx_camera_add_distortion(&empty, &behind, &out), PLX_ERROR_NOT_INITIALISED));
}

TEST(Camera, BuildersCheckTheirFieldsAndTypes)
{
    Plx_Camera c = make(kinds()[0]);
    const Plx_Camera before = c;
    EXPECT_TRUE(fails_with(plx_camera_build_linear(&c, 1, 0, 100, 0, 0), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_TRUE(fails_with(plx_camera_build_radial_1(&c, 1, 100, 0, 0, 0, 0.1), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_FALSE(plx_camera_build_xy_distortion(&c, 0, 100, 100, 0, 0, 0, 0, 0, 0));
    EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_FALSE(plx_camera_build_radial_2(&c, 1, 100, 100, 0, 0, std::nan(""), 0));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
    EXPECT_TRUE(fails_with(plx_camera_build_linear(nullptr, 1, 100, 100, 0, 0), PLX_ERROR_ILLEGAL_ARGUMENT));
    for (int32_t type : {6, 7, 8, 10, 11, -1, 42}) {
        EXPECT_FALSE(plx_camera_build_va(&c, type, 1.0, 100.0, 100.0, 0.0, 0.0, 0.0, 0.0)) << type;
        EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_TYPE) << type;
        Plx_Camera_f cf{};
        EXPECT_FALSE(plx_cameraf_build_va(&cf, type, 1.0, 100.0, 100.0, 0.0, 0.0, 0.0)) << type;
        EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_TYPE) << type;
    }
    EXPECT_EQ(std::memcmp(&c, &before, sizeof c), 0);  // every failure left the record alone

    // build_va gives the same record as the named builders.
    Plx_Camera named, va;
    ASSERT_TRUE(plx_camera_build_radial_2(&named, 2, 10, 20, 3, 4, 0.1, 0.2));
    ASSERT_TRUE(plx_camera_build_va(&va, PLX_RADIAL_CAMERA_2, 2.0, 10.0, 20.0, 3.0, 4.0, 0.1, 0.2));
    EXPECT_EQ(std::memcmp(&named, &va, sizeof va), 0);
    ASSERT_TRUE(plx_camera_build_affine(&named, 2, 10, 20, 5, 3, 4));
    ASSERT_TRUE(plx_camera_build_va(&va, PLX_AFFINE_CAMERA, 2.0, 10.0, 20.0, 3.0, 4.0, 5.0));
    EXPECT_EQ(std::memcmp(&named, &va, sizeof va), 0);

    EXPECT_TRUE(plx_camera_is_linear(&named));
    EXPECT_TRUE(plx_camera_is_linear(&c));
    Plx_Camera radial = make(kinds()[2]);
    EXPECT_FALSE(plx_camera_is_linear(&radial));
    EXPECT_FALSE(plx_camera_is_linear(nullptr));
}

TEST(Camera, InternalizeAndConversionRebuildTheOperations)
{
    for (const Kind &k : kinds()) {
        Plx_Camera original = make(k);
        // Fields copied as a file reader would, with no usable operations.
        Plx_Camera copy;
        std::memcpy(&copy, &original, sizeof copy);
        copy.point_project = nullptr;
        copy.point_backproject = nullptr;
        copy.point_add_distortion = nullptr;
        copy.point_remove_distortion = nullptr;
        copy.line_project = nullptr;
        copy.line_backproject = nullptr;
        ASSERT_TRUE(plx_camera_internalize(&copy)) << k.name;
        Plx_Vector3 p{0.25, -0.4, 1.0};
        Plx_Vector3 a = project(original, p), b = project(copy, p);
        EXPECT_EQ(a.x, b.x) << k.name;
        EXPECT_EQ(a.y, b.y) << k.name;

        Plx_Camera_f cf;
        Plx_Camera back;
        ASSERT_TRUE(plx_cameraf_from_camera_q(&original, &cf)) << k.name;
        ASSERT_TRUE(plx_camera_from_cameraf_q(&cf, &back)) << k.name;
        EXPECT_EQ(back.type, k.type);
        EXPECT_NEAR(back.fx, kFx, 1e-4);
        EXPECT_NEAR(back.k[0], original.k[0], 1e-7);
        b = project(back, p);
        EXPECT_NEAR(a.x, b.x, 1e-3) << k.name;
    }

    Plx_Camera c = make(kinds()[0]);
    const Plx_Camera before = c;
    c.type = PLX_FIXED_CORNER_WARP_CAMERA;
    EXPECT_TRUE(fails_with(plx_camera_internalize(&c), PLX_ERROR_ILLEGAL_TYPE));
    Plx_Camera_f cf{};
    EXPECT_TRUE(fails_with(plx_cameraf_from_camera_q(&c, &cf), PLX_ERROR_ILLEGAL_TYPE));
    c.type = PLX_CUBIC_BSPLINE_CAMERA_INV;
    EXPECT_TRUE(fails_with(plx_camera_internalize(&c), PLX_ERROR_ILLEGAL_TYPE));

    c = before;
    c.fy = 0;
    EXPECT_TRUE(fails_with(plx_camera_internalize(&c), PLX_ERROR_DIVISION_BY_ZERO));
    EXPECT_EQ(c.point_project, before.point_project);  // record left as it was

    c = before;
    c.fx = 1e300;  // beyond single precision
    EXPECT_TRUE(fails_with(plx_cameraf_from_camera_q(&c, &cf), PLX_ERROR_OUTSIDE_RANGE));
    EXPECT_EQ(cf.type, 0);
    EXPECT_EQ(cf.point_project, nullptr);
}
