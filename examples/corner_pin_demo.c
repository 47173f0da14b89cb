/* Corner pin on the C interface, the way a compositing host drives it: pin a 1920x1080
 * insert onto four tracked corners of a plate, map points through the pin, do the same
 * through a lens that bends the image edges, and show what a failure looks like. */
#include <math.h>
#include <stdio.h>

#include "plano/plano.h"

static Plx_Vector3 apply(const Plx_Matrix33 *H, Plx_Vector3 p)
{
    Plx_Vector3 q;
    plx_mat33_multv3_s(H, &p, &q);
    return q;
}

static void print_matrix(const char *name, const Plx_Matrix33 *H)
{
    int r;
    printf("%s =\n", name);
    for (r = 0; r < 3; ++r) printf("  [% 12.6f % 12.6f % 12.6f]\n", H->m[r][0], H->m[r][1], H->m[r][2]);
}

static int fail(const char *what)
{
    printf("%s failed:\n", what);
    plx_err_print_trace(stdout);
    return 1;
}

int main(void)
{
    /* The insert's corners, in the order (0,0), (1,0), (0,1), (1,1) of its own square. */
    const Plx_Vector3 insert[4] = {{0, 0, 1}, {1920, 0, 1}, {0, 1080, 1}, {1920, 1080, 1}};
    /* Where the tracker found them on the plate: a screen seen at an angle. */
    const Plx_Vector3 plate[4] = {{612.5, 240.0, 1}, {1418.0, 310.5, 1}, {590.0, 802.0, 1}, {1380.5, 745.0, 1}};
    const Plx_Vector3 probes[3] = {{960, 540, 1}, {0, 540, 1}, {480, 270, 1}};
    Plx_Matrix33 H;
    Plx_Vector3 centre;
    Plx_Camera lens;
    int i;

    printf("Corners twisted: %s\n",
           bCornerPointsTwisted((float)plate[0].x, (float)plate[0].y, (float)plate[1].x, (float)plate[1].y,
                                (float)plate[2].x, (float)plate[2].y, (float)plate[3].x, (float)plate[3].y)
               ? "yes"
               : "no");

    if (!bTex2Scene(plate, insert, NULL, NULL, &H)) return fail("bTex2Scene");
    print_matrix("Corner pin H (insert -> plate)", &H);
    for (i = 0; i < 4; ++i) {
        Plx_Vector3 q = apply(&H, insert[i]);
        printf("  insert corner %d -> (%8.3f, %8.3f)   tracked (%8.3f, %8.3f)\n", i, q.x / q.z, q.y / q.z,
               plate[i].x, plate[i].y);
    }
    for (i = 0; i < 3; ++i) {
        Plx_Vector3 q = apply(&H, probes[i]);
        printf("  insert (%6.1f, %6.1f) -> plate (%8.3f, %8.3f)\n", probes[i].x, probes[i].y, q.x / q.z, q.y / q.z);
    }
    if (!bComputeProjectiveCentre(plate, NULL, &centre)) return fail("bComputeProjectiveCentre");
    printf("Projective centre of the screen: (%8.3f, %8.3f)\n", centre.x / centre.z, centre.y / centre.z);

    /* A lens whose distortion bows the image edges but keeps the frame's corners. */
    if (!gbCameraBuildVA(&lens, PLX_FIXED_CORNER_WARP_CAMERA, 1.0, 1920.0, 1080.0, 960.0, 540.0, 0.01, -0.012,
                         0.008, 0.011, -0.006, 0.009, 0.007, -0.01, 0.02, -0.015, 0.01, 0.012))
        return fail("gbCameraBuildVA");
    {
        const Plx_Vector3 pixel = {1500.25, 200.75, 1};
        const Plx_Vector3 corner = {1920, 0, 1};
        Plx_Vector3 ray, back, undistorted;
        if (!lens.point_backproject(&lens, &pixel, &ray, NULL, NULL)) return fail("back-projection");
        if (!lens.point_project(&lens, &ray, &back, NULL, NULL, NULL)) return fail("projection");
        printf("Lens round trip: (%.4f, %.4f) -> ray (%.6f, %.6f) -> (%.4f, %.4f), error %.2e px\n", pixel.x,
               pixel.y, ray.x, ray.y, back.x, back.y, hypot(back.x - pixel.x, back.y - pixel.y));
        if (!lens.point_remove_distortion(&lens, &corner, &undistorted, NULL, NULL))
            return fail("distortion removal");
        printf("Frame corner (1920, 0) undistorted: (%.4f, %.4f)\n", undistorted.x, undistorted.y);
    }

    /* The same pin through the lens: H now lands on undistorted rays. */
    if (!bTex2Scene(plate, insert, NULL, &lens, &H)) return fail("bTex2Scene through the lens");
    print_matrix("Corner pin through the lens (insert -> rays)", &H);
    if (!bComputeProjectiveCentre(plate, &lens, &centre)) return fail("bComputeProjectiveCentre");
    printf("Projective centre through the lens: (%8.3f, %8.3f)\n", centre.x / centre.z * lens.zh,
           centre.y / centre.z * lens.zh);

    /* A failure: one corner at infinity. The call returns 0 and the trace says why. */
    {
        Plx_Vector3 broken[4] = {plate[0], plate[1], plate[2], {1, 1, 0}};
        if (bTex2Scene(broken, insert, NULL, NULL, &H)) {
            printf("unexpected success\n");
            return 1;
        }
        printf("A corner at infinity is refused; the error trace reads:\n");
        plx_err_print_trace(stdout);
    }
    return 0;
}
