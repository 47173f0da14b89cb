/* Small numerical helpers. */
#ifndef PELLUX_NUMERIC_H
#define PELLUX_NUMERIC_H

#include "pellux/base.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Real roots of a x^2 + b x + c = 0, computed without cancellation. Returns their number:
 * 2 (root1 <= root2; equal for a double root), 1 when a = 0 and b != 0 (root1 only), 0 when
 * the roots are complex, the equation is degenerate (a = b = 0) or a coefficient is not
 * finite. Roots are written only when they exist; either pointer may be null. Leaves the
 * error trace alone. */
PLX_API uint32_t plx_quadratic_solve(double a, double b, double c, double *root1, double *root2);

#ifdef __cplusplus
}
#endif

#endif
