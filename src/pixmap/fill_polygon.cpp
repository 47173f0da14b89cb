// bImageFillPolygon: one template over the pixel type for hard fills of every format and
// feathered blends of grey images.
#include <cmath>
#include <cstring>
#include <limits>
#include <vector>

#include "common/internal.hpp"
#include "pellux/detail/pixel_traits.hpp"
#include "pixmap/pixmap_internal.hpp"
#include "pixmap/pixmap_pixels.hpp"
#include "plano/polygon_fill.h"

namespace plano::pixmap {

namespace {

// Hard fill: the scan converter's spans written straight into the image's rows.
template <class T>
bool hard_fill(Plx_Image *image, const Polygon2D *polygon, const double *pixel, const char *function)
{
    const PixelValue<T> value(pixel, plx_image_format_channels(image->format));
    return fill_spans(image, polygon, function, [image, &value](int32_t y, int32_t first, int32_t last) {
        value.write_span(static_cast<T *>(plx_image_row(image, y)), first, last);
    });
}

// Feathered fill of a grey image: new = (1 - a) old + a pixel, in the pixel type's working
// precision; pixels with a = 0 are left exactly as they were.
template <class T>
void blend(Plx_Image *image, const Plx_Image *alpha, double pixel)
{
    using Accum = typename plx::PixelTraits<T>::Accum;
    const Accum p = Accum(pixel);
    for (int32_t r = 0; r < image->height; ++r) {
        const float *a = static_cast<const float *>(plx_image_row(alpha, r));
        T *row = static_cast<T *>(plx_image_row(image, r));
        for (int32_t c = 0; c < image->width; ++c) {
            if (a[c] == 0.0f) continue;
            const Accum w = Accum(a[c]);
            row[c] = to_pixel<T>(double((Accum(1) - w) * Accum(row[c]) + w * p));
        }
    }
}

// The feathered fill through a float grey image of the image's size and place, blended in.
template <class T>
bool feather_into(Plx_Image *image, const Polygon2D *polygon, double pixel, const char *function)
{
    Plx_Image alpha{};
    if (plx_image_form_gen_gl_f(&alpha, image->height, image->width) == nullptr) {
        plx_err_register_fileline(function, PLX_ERROR_CALLEE, __FILE__, __LINE__, "", 0);
        return false;
    }
    alpha.x = image->x, alpha.y = image->y;
    const bool ok = feather_fill(&alpha, nullptr, polygon, nullptr, nullptr, nullptr, function);
    if (ok) blend<T>(image, &alpha, pixel);
    plx_image_free(&alpha);
    return ok;
}

bool has_width(const Polygon2D *polygon)
{
    for (const Polygon2DEdge *e = polygon->head; e != nullptr; e = e->next)
        if (e->start_width != 0.0f || e->end_width != 0.0f) return true;
    return false;
}

}  // namespace

}  // namespace plano::pixmap

extern "C" {

PLANO_API Plx_Bool bImageFillPolygon(Plx_Image *image, const Polygon2D *polygon, const double *pixel, uint32_t mode)
{
    using namespace plano::pixmap;
    if (!check_polygon(polygon) || !check_image(image)) return 0;
    if (pixel == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null pixel", 0);
        return 0;
    }
    if (polygon->head == nullptr) return 1;
    if (image->type == PLX_TYPE_BIT) return fill_bits(image, polygon, pixel[0] >= 0.5 ? 1 : 0, mode, __func__) ? 1 : 0;
    if (mode != 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "unsupported", int64_t(mode));
        return 0;
    }
    bool ok = false;
    const bool feathered = has_width(polygon);
    const char *const function = __func__;  // inside the lambda __func__ names the lambda
    if (feathered && image->format != PLX_FORMAT_GREY) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_TYPE, "feathered fill of a non-grey image", int64_t(image->format));
        return 0;
    }
    if (!with_pixel_type(image, function, [&](auto t) {
            using T = decltype(t);
            ok = feathered ? feather_into<T>(image, polygon, pixel[0], function) : hard_fill<T>(image, polygon, pixel, function);
        }))
        return 0;
    return ok ? 1 : 0;
}

}  // extern "C"
