/* Homography and affine estimation from point pairs, and point normalisation.
 *
 * Points are homogeneous (x, y, w). A homography H is fitted so that H x is proportional to
 * x' for every pair (x, x'): each pair adds its two linear equations in the nine entries of H
 * to a 9x9 symmetric matrix (the sum of a a^T over equation rows a), and the solution is the
 * unit eigenvector of its smallest eigenvalue. An affine map is fitted by linear least squares
 * through the incremental pseudo-inverse solver. */
#ifndef PELLUX_GEOMETRY_H
#define PELLUX_GEOMETRY_H

#include "pellux/base.h"
#include "pellux/fixed.h"
#include "pellux/matrix.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Adds the pair x -> xp to the 9x9 symmetric accumulator A (a Plx_SquMatrix of symmetric
 * type and size 9, zeroed by the caller). */
PLX_API Plx_Bool plx_homog33_increment_p(Plx_SquMatrix *A, const Plx_Vector3 *x,
                                         const Plx_Vector3 *xp);
/* H from the accumulator; equations is the number of equation rows added (2 per pair) and
 * must be at least 8 (code 24). H has unit Frobenius norm and its largest-magnitude entry
 * positive. Pairs that leave H undetermined (a second eigenvalue at rounding level once the
 * accumulator is equilibrated: coincident or collinear points) fail with code 7. The fit is
 * only as well conditioned as the data: normalise the points first (plx_points_normalise). */
PLX_API Plx_Bool plx_homog33_solve(const Plx_SquMatrix *A, uint32_t equations, Plx_Matrix33 *H);

/* Incremental linear least squares: accumulates A^T W A and A^T W b one equation at a time
 * and solves (A^T W A) p = A^T W b. */
typedef struct Plx_PseudoInverseSolver {
    uint32_t unknowns;
    double *AtA;     /* unknowns x unknowns, row-major */
    double *Atb;     /* unknowns */
    uint32_t equations;
    uint32_t owned;  /* 1: the record came from the heap */
} Plx_PseudoInverseSolver;

PLX_API Plx_PseudoInverseSolver *plx_psinv_form(Plx_PseudoInverseSolver *solver, uint32_t unknowns);
PLX_API void plx_psinv_reset(Plx_PseudoInverseSolver *solver);
/* Adds one equation row . p = rhs with weight w and counts it in equations; a non-finite
 * weight or rhs fails with code 32. (Forming a solver of 0 unknowns fails with code 32.) */
PLX_API Plx_Bool plx_psinv_increment(Plx_PseudoInverseSolver *solver, const double *row,
                                     double rhs, double weight);
/* Solves for the unknowns; fewer equations than unknowns fail with code 24, a singular
 * system (an unknown no equation touches, or a pivot at rounding level once the normal
 * equations are equilibrated) with code 18. */
PLX_API Plx_Bool plx_psinv_solve(Plx_PseudoInverseSolver *solver, double *solution);
PLX_API void plx_psinv_free(Plx_PseudoInverseSolver *solver);

/* Adds the pair x -> xp (dehomogenised) to a six-unknown solver: the map
 * (u, v) -> (a u + b v + c, d u + e v + f). A solver of another size fails with code 7, a
 * point with w = 0 with code 18. */
PLX_API Plx_Bool plx_affine33_increment_p(Plx_PseudoInverseSolver *solver, const Plx_Vector3 *x,
                                          const Plx_Vector3 *xp);
/* The affine map [[a, b, c], [d, e, f]]; equations is the number of equation rows added and
 * must be at least 6 (code 24). */
PLX_API Plx_Bool plx_affine33_solve(Plx_PseudoInverseSolver *solver, uint32_t equations,
                                    Plx_Matrix23 *A);

/* Normalising transform of a point set: T translates the centroid (of the dehomogenised
 * points) to the origin and scales their RMS distance from it to sqrt(2), with the scale
 * factor capped at max_scale. A set whose RMS distance is below tolerance, or a point with
 * w = 0, fails with code 24. out (optional, n points) receives T x_i. */
PLX_API Plx_Bool plx_points_normalise(const Plx_Vector3 *points, uint32_t n, double max_scale,
                                      double tolerance, Plx_Vector3 *out, Plx_Matrix33 *T);

#ifdef __cplusplus
}
#endif

#endif
