// Corner pins, affine fits, projective centres and twist tests.
#include <gtest/gtest.h>

#include <cmath>

#include "plano/plano.h"

namespace {

Plx_Vector3 apply(const Plx_Matrix33 &H, const Plx_Vector3 &p)
{
    return {H.m[0][0] * p.x + H.m[0][1] * p.y + H.m[0][2] * p.z,
            H.m[1][0] * p.x + H.m[1][1] * p.y + H.m[1][2] * p.z,
            H.m[2][0] * p.x + H.m[2][1] * p.y + H.m[2][2] * p.z};
}

double norm(const Plx_Vector3 &a) { return std::sqrt(a.x * a.x + a.y * a.y + a.z * a.z); }

// H t is a positive multiple of p (to a relative tolerance).
::testing::AssertionResult MapsOnto(const Plx_Matrix33 &H, const Plx_Vector3 &t, const Plx_Vector3 &p,
                                    double tol = 1e-9)
{
    Plx_Vector3 q = apply(H, t);
    Plx_Vector3 c{q.y * p.z - q.z * p.y, q.z * p.x - q.x * p.z, q.x * p.y - q.y * p.x};
    double scale = norm(q) * norm(p);
    double dot = q.x * p.x + q.y * p.y + q.z * p.z;
    if (scale > 0 && norm(c) <= tol * scale && dot > 0) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "H t = (" << q.x << ", " << q.y << ", " << q.z << ") vs p = ("
                                         << p.x << ", " << p.y << ", " << p.z << ")";
}

int32_t origin_code()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.code : -1;
}

int32_t last_code()
{
    Plx_ErrorRecord r;
    uint32_t n = plx_err_get_error_count();
    return n > 0 && plx_err_get_error(n - 1, &r) ? r.code : -1;
}

const Plx_Vector3 kUnitSquare[4] = {{0, 0, 1}, {1, 0, 1}, {0, 1, 1}, {1, 1, 1}};
// A perspective view of a 100-pixel square.
const Plx_Matrix33 kH0 = {{{2.0, 0.3, 5.0}, {0.1, 1.5, -3.0}, {0.001, 0.002, 1.0}}};

void map_all(const Plx_Matrix33 &H, const Plx_Vector3 in[4], Plx_Vector3 out[4])
{
    for (int i = 0; i < 4; ++i) out[i] = apply(H, in[i]);
}

// A lens that bends the image edges (a 640x480 frame).
Plx_Camera distorting_camera()
{
    Plx_Camera c;
    EXPECT_TRUE(gbCameraBuildVA(&c, PLX_FIXED_CORNER_WARP_CAMERA, 1.0, 640.0, 480.0, 320.0, 240.0, 0.01, -0.02,
                                0.015, 0.005, -0.01, 0.02, 0.01, -0.015, 0.03, -0.02, 0.01, 0.02));
    return c;
}

}  // namespace

TEST(FourPoint, ExactMapsKnownQuads)
{
    // Texture equal to the scene: the identity, with unit scale.
    const Plx_Vector3 quad[4] = {{10, 20, 1}, {110, 25, 1}, {5, 130, 1}, {120, 140, 1}};
    Plx_Matrix33 H;
    ASSERT_TRUE(bTex2Scene(quad, quad, nullptr, nullptr, &H));
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(H.m[r][c], r == c ? 1.0 : 0.0, 1e-12);

    // Unit square onto (0,0), (2,0), (0,2), (3,3), worked by hand: g = h = -1/4, so
    // H = [[1.5, 0, 0], [0, 1.5, 0], [-0.25, -0.25, 1]].
    const Plx_Vector3 kite[4] = {{0, 0, 1}, {2, 0, 1}, {0, 2, 1}, {3, 3, 1}};
    const Plx_Matrix33 expected = {{{1.5, 0, 0}, {0, 1.5, 0}, {-0.25, -0.25, 1}}};
    ASSERT_TRUE(bTex2Scene(kite, kUnitSquare, nullptr, nullptr, &H));
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(H.m[r][c], expected.m[r][c], 1e-14);

    // A perspective homography is recovered from its four corners, whatever their w.
    const Plx_Vector3 tex[4] = {{0, 0, 1}, {200, 0, 2}, {0, 100, 1}, {50, 50, 0.5}};
    Plx_Vector3 scene[4];
    map_all(kH0, tex, scene);
    ASSERT_TRUE(bTex2Scene(scene, tex, nullptr, nullptr, &H));
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(H.m[r][c] / H.m[2][2], kH0.m[r][c], 1e-9 * (1 + std::fabs(kH0.m[r][c])));
}

TEST(FourPoint, DegenerateCornersGoThroughTheLinearFit)
{
    // A texture square 1e-5 wide: the unit-square route's absolute threshold refuses it
    // (den = 1e-10), the normalised linear fit does not.
    Plx_Vector3 tex[4], scene[4];
    for (int i = 0; i < 4; ++i) tex[i] = {kUnitSquare[i].x * 1e-5, kUnitSquare[i].y * 1e-5, 1};
    map_all(kH0, tex, scene);
    Plx_Matrix33 H;
    ASSERT_TRUE(bTex2Scene(scene, tex, nullptr, nullptr, &H));
    for (int i = 0; i < 4; ++i) EXPECT_TRUE(MapsOnto(H, tex[i], scene[i], 1e-7)) << "corner " << i;

    // Corners 1, 2 and 3 on one line leave the homography undetermined by four points: the
    // fit refuses too, and the failure is passed on.
    const Plx_Vector3 collinear[4] = {{0, 0, 1}, {2, 0, 1}, {0, 2, 1}, {1, 1, 1}};
    map_all(kH0, collinear, scene);
    EXPECT_FALSE(bTex2Scene(scene, collinear, nullptr, nullptr, &H));
    EXPECT_EQ(last_code(), PLX_ERROR_CALLEE);
}

TEST(FourPoint, OrientationFollowsTheSceneSide)
{
    const Plx_Vector3 tex[4] = {{0, 0, 1}, {100, 0, 1}, {0, 100, 1}, {100, 100, 1}};
    Plx_Vector3 front[4], behind[4];
    map_all(kH0, tex, front);
    for (int i = 0; i < 4; ++i) behind[i] = {-front[i].x, -front[i].y, -front[i].z};
    Plx_Matrix33 Hf, Hb;
    ASSERT_TRUE(bTex2Scene(front, tex, nullptr, nullptr, &Hf));
    ASSERT_TRUE(bTex2Scene(behind, tex, nullptr, nullptr, &Hb));
    for (int i = 0; i < 4; ++i) EXPECT_TRUE(MapsOnto(Hb, tex[i], behind[i]));
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_DOUBLE_EQ(Hb.m[r][c], -Hf.m[r][c]);

    // One corner on the other side: no sign of H keeps all four in front.
    Plx_Vector3 mixed[4] = {front[0], front[1], front[2], behind[3]};
    Plx_Matrix33 untouched = {{{7, 7, 7}, {7, 7, 7}, {7, 7, 7}}};
    EXPECT_FALSE(bTex2Scene(mixed, tex, nullptr, nullptr, &untouched));
    EXPECT_EQ(origin_code(), PLX_ERROR_INCOMPATIBLE);
    EXPECT_EQ(untouched.m[1][2], 7.0);
}

TEST(FourPoint, BadInputsFailWithTheirCodes)
{
    Plx_Matrix33 H;
    Plx_Vector3 scene[4] = {{0, 0, 1}, {1, 0, 1}, {0, 1, 1}, {1, 1, 0}};
    EXPECT_FALSE(bTex2Scene(scene, kUnitSquare, nullptr, nullptr, &H));
    EXPECT_EQ(origin_code(), PLX_ERROR_INCOMPATIBLE);  // corner at infinity

    EXPECT_FALSE(bTex2Scene(nullptr, kUnitSquare, nullptr, nullptr, &H));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);

    // All four scene corners in one place: nothing to fit, reported over the callee.
    const Plx_Vector3 point[4] = {{3, 3, 1}, {3, 3, 1}, {3, 3, 1}, {3, 3, 1}};
    EXPECT_FALSE(bTex2Scene(point, kUnitSquare, nullptr, nullptr, &H));
    EXPECT_EQ(last_code(), PLX_ERROR_CALLEE);

    // A singular reference homography cannot be inverted.
    const Plx_Matrix33 G = {{{1, 0, 0}, {0, 1, 0}, {0, 0, 0}}};
    EXPECT_FALSE(bTex2Scene(kUnitSquare, kUnitSquare, &G, nullptr, &H));
    EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_EQ(last_code(), PLX_ERROR_CALLEE);

    // A camera that cannot back-project a scene point.
    Plx_Camera cam = distorting_camera();
    EXPECT_FALSE(bTex2Scene(scene, kUnitSquare, nullptr, &cam, &H));
    EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);
    EXPECT_EQ(last_code(), PLX_ERROR_CALLEE);
}

TEST(FourPoint, ReferenceHomographyAndCameraAreUndoneFirst)
{
    const Plx_Vector3 tex[4] = {{0, 0, 1}, {1, 0, 1}, {0, 1, 1}, {1, 1, 1}};
    const Plx_Vector3 scene[4] = {{100, 80, 1}, {520, 60, 1}, {90, 400, 1}, {560, 430, 1}};
    const Plx_Matrix33 G = {{{1.1, 0.05, 3}, {-0.02, 0.95, 7}, {1e-4, -2e-4, 1}}};
    Plx_Matrix33 Ginv;
    ASSERT_TRUE(plx_mat33_invert_s(&G, &Ginv));

    Plx_Matrix33 H;
    ASSERT_TRUE(bTex2Scene(scene, tex, &G, nullptr, &H));
    for (int i = 0; i < 4; ++i) EXPECT_TRUE(MapsOnto(H, tex[i], apply(Ginv, scene[i])));

    // Through a distorting camera H lands on the back-projected (undistorted) rays.
    Plx_Camera cam = distorting_camera();
    ASSERT_TRUE(bTex2Scene(scene, tex, nullptr, &cam, &H));
    for (int i = 0; i < 4; ++i) {
        Plx_Vector3 ray;
        ASSERT_TRUE(cam.point_backproject(&cam, &scene[i], &ray, nullptr, nullptr));
        EXPECT_TRUE(MapsOnto(H, tex[i], ray));
    }
}

TEST(FourPoint, AffineFitIsExactOnAffineData)
{
    const Plx_Matrix33 A = {{{1.2, -0.3, 7.0}, {0.4, 0.9, -2.0}, {0, 0, 1}}};
    // The texture's w varies, the first one's included: the fit works on the points they
    // stand for, and H keeps each point's w rather than rescaling by the first.
    const Plx_Vector3 tex[5] = {{4, 2, 2}, {20, 0, 2}, {0, 10, 1}, {30, 40, 1}, {-5, 12, 0.5}};
    Plx_Vector3 scene[5];
    for (int i = 0; i < 5; ++i) scene[i] = apply(A, tex[i]);
    Plx_Matrix33 H;
    ASSERT_TRUE(bTex2SceneAffine(scene, tex, 5, nullptr, &H));
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(H.m[r][c], A.m[r][c], 1e-9);
    for (int i = 0; i < 5; ++i) EXPECT_TRUE(MapsOnto(H, tex[i], scene[i]));


    EXPECT_FALSE(bTex2SceneAffine(scene, tex, 2, nullptr, &H));  // too few for six unknowns
    EXPECT_EQ(last_code(), PLX_ERROR_CALLEE);
    Plx_Vector3 at_infinity[5] = {scene[0], scene[1], {1, 1, 0}, scene[3], scene[4]};
    Plx_Camera cam = distorting_camera();
    EXPECT_FALSE(bTex2SceneAffine(at_infinity, tex, 5, &cam, &H));
    EXPECT_EQ(origin_code(), PLX_ERROR_DIVISION_BY_ZERO);
}

TEST(FourPoint, ProjectiveCentreIsWhereTheDiagonalsCross)
{
    Plx_Vector3 c;
    const Plx_Vector3 square[4] = {{0, 0, 1}, {4, 0, 1}, {0, 4, 1}, {4, 4, 1}};
    ASSERT_TRUE(bComputeProjectiveCentre(square, nullptr, &c));
    EXPECT_NEAR(c.x / c.z, 2.0, 1e-12);
    EXPECT_NEAR(c.y / c.z, 2.0, 1e-12);

    // Trapezoid: diagonals (0,0)-(3,2) and (4,0)-(1,2) cross at (2, 4/3), not at the
    // average of the corners (2, 1).
    const Plx_Vector3 trapezoid[4] = {{0, 0, 1}, {4, 0, 1}, {1, 2, 1}, {3, 2, 1}};
    ASSERT_TRUE(bComputeProjectiveCentre(trapezoid, nullptr, &c));
    EXPECT_NEAR(c.x / c.z, 2.0, 1e-12);
    EXPECT_NEAR(c.y / c.z, 4.0 / 3.0, 1e-12);

    // Through a distorting camera the crossing is found among the undistorted rays and the
    // result is a pixel again.
    Plx_Camera cam = distorting_camera();
    const Plx_Vector3 quad[4] = {{100, 80, 1}, {520, 60, 1}, {90, 400, 1}, {560, 430, 1}};
    ASSERT_TRUE(bComputeProjectiveCentre(quad, &cam, &c));
    EXPECT_EQ(c.z, cam.zh);
    Plx_Vector3 r[4], rc;
    for (int i = 0; i < 4; ++i) ASSERT_TRUE(cam.point_backproject(&cam, &quad[i], &r[i], nullptr, nullptr));
    ASSERT_TRUE(cam.point_backproject(&cam, &c, &rc, nullptr, nullptr));
    // rc lies on both diagonals r0-r3 and r1-r2 (all rays have w = 1).
    auto side = [](const Plx_Vector3 &a, const Plx_Vector3 &b, const Plx_Vector3 &p) {
        return (b.x - a.x) * (p.y - a.y) - (b.y - a.y) * (p.x - a.x);
    };
    EXPECT_NEAR(side(r[0], r[3], rc), 0.0, 1e-10);
    EXPECT_NEAR(side(r[1], r[2], rc), 0.0, 1e-10);

    EXPECT_FALSE(bComputeProjectiveCentre(square, nullptr, nullptr));
    EXPECT_EQ(origin_code(), PLX_ERROR_ILLEGAL_ARGUMENT);
}

TEST(FourPoint, TwistedCorners)
{
    // Square in corner order (0,0), (1,0), (0,1), (1,1), and its mirror image.
    EXPECT_FALSE(bCornerPointsTwisted(0, 0, 1, 0, 0, 1, 1, 1));
    EXPECT_FALSE(bCornerPointsTwisted(0, 0, 0, 1, 1, 0, 1, 1));
    // Swapping corners 2 and 3 makes a bow tie, in either orientation.
    EXPECT_TRUE(bCornerPointsTwisted(0, 0, 1, 0, 1, 1, 0, 1));
    EXPECT_TRUE(bCornerPointsTwisted(0, 0, 0, 1, 1, 1, 1, 0));
    // A dart: corner 3 pushed inside the triangle of the others.
    EXPECT_TRUE(bCornerPointsTwisted(0, 0, 4, 0, 0, 4, 1, 1));
    // A convex perspective quad is fine; collapsing it onto a line is not.
    EXPECT_FALSE(bCornerPointsTwisted(100, 80, 520, 60, 90, 400, 560, 430));
    EXPECT_TRUE(bCornerPointsTwisted(0, 0, 1, 1, 2, 2, 3, 3));
}
