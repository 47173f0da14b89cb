// Small numerical helpers.
#include <cmath>
#include <utility>

#include "pellux/numeric.h"

extern "C" {

PLX_API uint32_t plx_quadratic_solve(double a, double b, double c, double *root1, double *root2)
{
    if (!std::isfinite(a) || !std::isfinite(b) || !std::isfinite(c)) return 0;
    if (a == 0.0) {
        if (b == 0.0) return 0;
        if (root1) *root1 = -c / b;
        return 1;
    }
    // Scale by a power of two near the largest coefficient (exact) so b^2 - 4ac neither
    // overflows nor underflows.
    int e = std::ilogb(std::fmax(std::fabs(a), std::fmax(std::fabs(b), std::fabs(c))));
    double as = std::ldexp(a, -e), bs = std::ldexp(b, -e), cs = std::ldexp(c, -e);
    double disc = bs * bs - 4.0 * as * cs;
    if (disc < 0.0) return 0;
    // q has the sign of b, so b + sign(b) sqrt(disc) never cancels; the second root comes
    // from the product of the roots, c / a.
    double q = -0.5 * (bs + std::copysign(std::sqrt(disc), bs));
    double r1, r2;
    if (q == 0.0) {
        r1 = r2 = 0.0;  // b = 0 and disc = 0, so c = 0 as well
    } else {
        r1 = q / as;
        r2 = cs / q;
    }
    if (r2 < r1) std::swap(r1, r2);
    if (root1) *root1 = r1;
    if (root2) *root2 = r2;
    return 2;
}

}  // extern "C"
