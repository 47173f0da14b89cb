// Picking the peak of a correlation image.
#include "plano/track_correlation.h"

namespace {

template <class A>
bool best_peak(const Plx_Image *im, double min_overlap, double min_score, double sharpness, int32_t *row,
               int32_t *col, double *best)
{
    const int32_t h = im->height, w = im->width;
    const int step = im->format == PLX_FORMAT_VECTOR2D ? 2 : 1;
    double top = *best;
    int32_t pr = -1, pc = -1;
    // Last row first and, within a row, last column first: of equal scores the first seen
    // (largest row, then largest column) is kept, since a later one must be strictly larger.
    for (int32_t r = h - 1; r >= 0; --r) {
        const A *p = static_cast<const A *>(plx_image_row(im, r));
        for (int32_t c = w - 1; c >= 0; --c) {
            const double v = double(p[c * step]);
            if (v > top && v >= min_score && (step == 1 || double(p[c * step + 1]) >= min_overlap)) {
                top = v;
                pr = r;
                pc = c;
            }
        }
    }
    if (pr < 0) return true;
    *row = pr;
    *col = pc;
    if (sharpness == 0) {
        *best = top;
        return true;
    }
    if (pr == 0 || pc == 0 || pr == h - 1 || pc == w - 1) return true;
    auto at = [&](int32_t dr, int32_t dc) {
        return double(static_cast<const A *>(plx_image_row(im, pr + dr))[(pc + dc) * step]);
    };
    const double v = at(0, 0);
    const double n = at(-1, 0), s = at(1, 0), west = at(0, -1), e = at(0, 1);
    const double ne = at(-1, 1), sw = at(1, -1), nw = at(-1, -1), se = at(1, 1);
    if (v - (west + e) / 2 >= sharpness && v - (n + s) / 2 >= sharpness && v / 2 - (ne + sw) / 4 >= sharpness &&
        v / 2 - (nw + se) / 4 >= sharpness)
        *best = v;
    return true;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bGetBestCorrScore(const Plx_Image *correlation, double min_overlap, double min_score,
                                     double sharpness, int32_t *row, int32_t *col, double *best)
{
    if (correlation == nullptr || row == nullptr || col == nullptr || best == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null correlation image or output", 0);
        return 0;
    }
    if (correlation->format != PLX_FORMAT_GREY && correlation->format != PLX_FORMAT_VECTOR2D) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_FORMAT, "correlation images are grey or 2D vector fields", correlation->format);
        return 0;
    }
    if (correlation->type == PLX_TYPE_FLOAT)
        return best_peak<float>(correlation, min_overlap, min_score, sharpness, row, col, best) ? 1 : 0;
    if (correlation->type == PLX_TYPE_DOUBLE)
        return best_peak<double>(correlation, min_overlap, min_score, sharpness, row, col, best) ? 1 : 0;
    PLX_ERR_START(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "correlation images are float or double", correlation->type);
    return 0;
}

}  // extern "C"
