// Quadrilaterals of the tool: parsing, mapping by homographies, filling into bit masks.
//
// Positions are continuous image coordinates: pixel (c, r) covers [c, c + 1) x [r, r + 1), so
// its centre is (c + 0.5, r + 0.5), as in the projective warp. A quad's corners run around
// its boundary; the tool keeps the order the user gave (top-left, top-right, bottom-right,
// bottom-left is the natural one, and the one the insert command maps an image's corners to).
#ifndef PLANO_TOOL_GEOMETRY_HPP
#define PLANO_TOOL_GEOMETRY_HPP

#include <array>
#include <string>

#include "tool.hpp"

namespace plano_tool {

struct Point {
    double x = 0, y = 0;
};
using Quad = std::array<Point, 4>;

// "x1,y1,x2,y2,x3,y3,x4,y4" (commas or blanks).
Quad parse_quad(const std::string &text);
// Refuses a quad with a corner outside a width x height image, a twisted or non-convex quad,
// or one that covers no pixel centre.
void check_quad(const Quad &quad, int32_t width, int32_t height);
// The rectangle around the set pixels of a bit mask; throws when it has none.
Quad quad_of_mask(const Plx_Image &mask);

Point map_through(const Plx_Matrix33 &H, Point p);
Quad map_through(const Plx_Matrix33 &H, const Quad &quad);
// A times B, and the inverse of A (throws when A is singular).
Plx_Matrix33 multiply(const Plx_Matrix33 &A, const Plx_Matrix33 &B);
Plx_Matrix33 inverse(const Plx_Matrix33 &A);
// H scaled so that its last entry is 1, the form files carry (left as it is when that entry
// is within 1e-12 of 0).
Plx_Matrix33 with_unit_h22(Plx_Matrix33 H);
// The homography taking each corner of `from` onto the same corner of `to`.
Plx_Matrix33 homography_between(const Quad &from, const Quad &to);
// The corners of a width x height image, top-left first, clockwise on screen.
Quad image_corners(double width, double height);

// A bit image of width x height with the pixels whose centres lie inside the quad set.
ImagePtr fill_quad(const Quad &quad, int32_t width, int32_t height);
// Signed distance from p to the quad's boundary: positive inside.
double distance_inside(const Quad &quad, Point p);

}  // namespace plano_tool

#endif
