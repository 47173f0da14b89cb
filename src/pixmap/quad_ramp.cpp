// Ramps over one quadrilateral band: the grey multiply ramp, and the soft edge between two
// corresponding outlines, which is a chain of such bands.
#include <algorithm>
#include <cmath>

#include "common/internal.hpp"
#include "pellux/detail/pixel_traits.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "pixmap/pixmap_pixels.hpp"
#include "pixmap/pixmap_spans.hpp"
#include "plano/polygon_fill.h"

namespace plano::pixmap {

namespace {

BandQuad quad_of(const Plx_Vector2_f &s, const Plx_Vector2_f &e, const Plx_Vector2_f &a, const Plx_Vector2_f &b)
{
    return BandQuad{s.x, s.y, e.x, e.y, a.x, a.y, b.x, b.y};
}

// The whole pixels from floor(lo) - 2 to floor(hi) + 2 of frame coordinates, less offset and
// clamped to [0, size): [*first, *end).
void widened_range(double lo, double hi, int32_t offset, int32_t size, int32_t *first, int32_t *end)
{
    *first = clamp_index(std::floor(lo) - 2.0 - offset, 0, size);
    *end = clamp_index(std::floor(hi) + 3.0 - offset, 0, size);
}

// The soft edge into a grey image of type T: each band pixel takes 1 - lambda of full scale
// (1 on the inner outline, 0 on the outer one) where that is more than it holds. A pixel
// that the previous band covered is left to it, so the seam between neighbours is covered
// once.
template <class T>
void soft_edge(const Polygon2D *inner, const Polygon2D *outer, Plx_Image *image, Plx_Image *masks[2])
{
    constexpr double full = plx::PixelTraits<T>::scale;
    Plx_Window previous_box{0, 0, 0, 0};
    int current = 0;
    for (const Polygon2DEdge *i = inner->head, *o = outer->head; i != nullptr && o != nullptr;
         i = i->next, o = o->next) {
        const BandQuad q{i->x, i->y, i->end_x, i->end_y, o->x, o->y, o->end_x, o->end_y};
        Plx_Image *mine = masks[current], *theirs = masks[1 - current];
        int32_t lo_r = image->height, hi_r = -1, lo_c = image->width, hi_c = -1;
        if (!band_degenerate(q))
            for_band_pixels(image, q, 0, image->height, [&](int32_t r, int32_t c, double lambda) {
                if (lambda < 0.0 || lambda > 1.0 || bit_at(static_cast<const uint32_t *>(plx_image_row(theirs, r)), c))
                    return;
                apply_bits(static_cast<uint32_t *>(plx_image_row(mine, r)), c, c, BitOp::set);
                lo_r = std::min(lo_r, r), hi_r = std::max(hi_r, r), lo_c = std::min(lo_c, c), hi_c = std::max(hi_c, c);
                T &p = static_cast<T *>(plx_image_row(image, r))[c];
                const T v = to_pixel<T>((1.0 - lambda) * full);
                if (v > p) p = v;
            });
        // The previous band's marks are spent; this band's become the previous ones.
        if (previous_box.width > 0) plx_image_fill_zero_window(theirs, previous_box);
        previous_box = hi_r >= 0 ? Plx_Window{lo_c, lo_r, hi_c - lo_c + 1, hi_r - lo_r + 1} : Plx_Window{0, 0, 0, 0};
        current = 1 - current;
    }
}

}  // namespace

}  // namespace plano::pixmap

extern "C" {

PLANO_API Plx_Bool bFillQuadrilateralWithRampGreyUchar(Plx_Image *image, const Plx_Vector2_f *a,
                                                       const Plx_Vector2_f *b, const Plx_Vector2_f *s,
                                                       const Plx_Vector2_f *e)
{
    using namespace plano::pixmap;
    if (!check_image(image)) return 0;
    if (a == nullptr || b == nullptr || s == nullptr || e == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null corner", 0);
        return 0;
    }
    if (image->format != PLX_FORMAT_GREY || image->type != PLX_TYPE_UCHAR) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "not an unsigned-char grey image", int64_t(image->type));
        return 0;
    }
    const BandQuad q = quad_of(*s, *e, *a, *b);
    if (band_degenerate(q)) return 1;
    // The corners' whole-pixel box widened by two pixels: the cleared half band beyond S-E
    // reaches that far past the corners.
    int32_t r0, r1, c0, c1;
    widened_range(std::fmin(std::fmin(q.sy, q.ey), std::fmin(q.ay, q.by)),
                  std::fmax(std::fmax(q.sy, q.ey), std::fmax(q.ay, q.by)), image->y, image->height, &r0, &r1);
    widened_range(std::fmin(std::fmin(q.sx, q.ex), std::fmin(q.ax, q.bx)),
                  std::fmax(std::fmax(q.sx, q.ex), std::fmax(q.ax, q.bx)), image->x, image->width, &c0, &c1);
    for (int32_t r = r0; r < r1; ++r) {
        uint8_t *row = static_cast<uint8_t *>(plx_image_row(image, r));
        for (int32_t c = c0; c < c1; ++c) {
            double s_band, lambda;
            if (!band_coordinates(q, c + image->x + 0.5, r + image->y + 0.5, true, 1e-4, &s_band, &lambda)) continue;
            if (lambda >= -0.5 && lambda < 0.0)
                row[c] = 0;
            else if (lambda >= 0.0 && lambda < 1.0)
                row[c] = uint8_t(row[c] * lambda);
        }
    }
    return 1;
}

PLANO_API Plx_Bool bFillPolygonSoftEdge(const Polygon2D *inner, const Polygon2D *outer, Plx_Image *image,
                                        Plx_Image *scratch_a, Plx_Image *scratch_b)
{
    using namespace plano::pixmap;
    if (!check_polygon(inner) || !check_polygon(outer) || !check_image(image)) return 0;
    if ((scratch_a == nullptr) != (scratch_b == nullptr) || (scratch_a != nullptr && scratch_a == scratch_b)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "pass two scratch masks or neither", 0);
        return 0;
    }
    if (uiPolygon2DNumberOfPoints(inner) != uiPolygon2DNumberOfPoints(outer)) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "outlines of different lengths", 0);
        return 0;
    }
    if (image->format != PLX_FORMAT_GREY || image->type == PLX_TYPE_BIT) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "soft edge needs a grey image", int64_t(image->type));
        return 0;
    }
    Plx_Image own[2] = {};
    Plx_Image *masks[2] = {scratch_a, scratch_b};
    struct Guard {
        Plx_Image *images;
        ~Guard() { plx_image_free(&images[0]), plx_image_free(&images[1]); }
    } guard{own};
    for (int k = 0; k < 2; ++k) {
        if (masks[k] == nullptr) {
            if (plx_image_form_gen_b(&own[k], image->height, image->width) == nullptr) {
                PLX_ERR_PASS();
                return 0;
            }
            masks[k] = &own[k];
        } else if (!check_bit_image(masks[k], __func__)) {
            return 0;
        } else if (masks[k]->width != image->width || masks[k]->height != image->height) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "scratch mask of another size", 0);
            return 0;
        }
        if (!plx_image_fill_zero(masks[k])) {
            PLX_ERR_PASS();
            return 0;
        }
    }
    return with_pixel_type(image, __func__, [&](auto t) { soft_edge<decltype(t)>(inner, outer, image, masks); }) ? 1 : 0;
}

}  // extern "C"
