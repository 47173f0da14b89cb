// The projective warp's set-up and row loop: checks, background and validity set-up, the
// output region clipped to where the source can land, and the rows of the region pushed
// through positions, sampling and writing.
#include <algorithm>
#include <cmath>
#include <cstring>

#include "common/internal.hpp"
#include "image/projective_warp_internal.hpp"

namespace plano::warp {

namespace {

constexpr int32_t kDefaultTile = 16;
constexpr uint32_t kMaxTile = 1u << 16;
// Rows between progress reports.
constexpr int32_t kProgressRows = 50;
// Rows go in bands, each band in strips of columns, so that under rotation the source rows
// a strip reads stay in cache from one row to the next (about 15% faster at 1080p). The
// interrupt query is still asked after every row (after every row of tiles in the fast
// render).
constexpr int32_t kBandRows = 16;
constexpr int32_t kStripWidth = 128;
// Points per source-region edge when the mapping bends lines, and the margin added to
// their bounding box for the bulge between them.
constexpr int kEdgeSamples = 32;
constexpr double kBendMargin = 2.0;

int32_t floor_div(int32_t a, int32_t b) { return a >= 0 ? a / b : -((-a + b - 1) / b); }

bool supported_format(Plx_ImageFormat f) { return format_info(f).channels > 0; }

bool supported_type(Plx_ImageFormat f, Plx_PixelType t)
{
    if (t == PLX_TYPE_BIT) return f == PLX_FORMAT_GREY;
    return t >= PLX_TYPE_UCHAR && t <= PLX_TYPE_DOUBLE;
}

Plx_Window frame_extent(const Plx_Image *image) { return Plx_Window{image->x, image->y, image->width, image->height}; }

bool empty(const Plx_Window &w) { return w.width <= 0 || w.height <= 0; }

// The active subwindow of a bit image, in frame coordinates.
bool active_frame_window(const Plx_Image *mask, Plx_Window &w, const char *caller)
{
    if (!plx_image_get_active_subwindow_b(mask, &w)) {
        plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "no active subwindow", 0);
        return false;
    }
    w.x += mask->x;
    w.y += mask->y;
    return true;
}

// Clears the validity bits of a frame rectangle (the part inside the validity mask).
void clear_validity(Plx_Image *validity, Plx_Window frame)
{
    if (validity == nullptr || empty(frame)) return;
    Plx_Window local{frame.x - validity->x, frame.y - validity->y, frame.width, frame.height};
    local = plx_window_intersect(local, Plx_Window{0, 0, validity->width, validity->height});
    if (empty(local)) return;
    plx_image_fill_zero_window(validity, local);
}

// Clears the bits of `requested` that lie outside `region` (a part of it).
void clear_validity_outside(Plx_Image *validity, const Plx_Window &req, const Plx_Window &region)
{
    if (validity == nullptr) return;
    if (empty(region)) {
        clear_validity(validity, req);
        return;
    }
    const int32_t rx1 = region.x + region.width, ry1 = region.y + region.height;
    clear_validity(validity, Plx_Window{req.x, req.y, req.width, region.y - req.y});
    clear_validity(validity, Plx_Window{req.x, ry1, req.width, req.y + req.height - ry1});
    clear_validity(validity, Plx_Window{req.x, region.y, region.x - req.x, region.height});
    clear_validity(validity, Plx_Window{rx1, region.y, req.x + req.width - rx1, region.height});
}

// The output pixels the source region (widened by a pixel, for the high-quality edge ramp)
// can reach, within `within`; false when some point cannot be mapped back (no clipping).
bool projected_box(const Mapping &map, const Plx_Window &src, const Plx_Window &within, Plx_Window &box)
{
    const double x0 = double(src.x) - 1.0, y0 = double(src.y) - 1.0;
    const double x1 = double(src.x) + src.width + 1.0, y1 = double(src.y) + src.height + 1.0;
    const int steps = map.distorted ? kEdgeSamples : 1;
    double lox = HUGE_VAL, loy = HUGE_VAL, hix = -HUGE_VAL, hiy = -HUGE_VAL;
    auto visit = [&](double sx, double sy) {
        double x, y;
        if (!unmap_point(map, sx, sy, x, y)) return false;
        lox = std::min(lox, x), hix = std::max(hix, x);
        loy = std::min(loy, y), hiy = std::max(hiy, y);
        return true;
    };
    for (int k = 0; k < steps; ++k) {
        const double t = double(k) / steps;
        if (!visit(x0 + t * (x1 - x0), y0) || !visit(x1, y0 + t * (y1 - y0)) || !visit(x1 - t * (x1 - x0), y1) ||
            !visit(x0, y1 - t * (y1 - y0)))
            return false;
    }
    const double margin = map.distorted ? kBendMargin : 0.0;
    const double bx0 = std::max(std::floor(lox - margin) - 1.0, double(within.x));
    const double by0 = std::max(std::floor(loy - margin) - 1.0, double(within.y));
    const double bx1 = std::min(std::ceil(hix + margin) + 1.0, double(within.x) + within.width);
    const double by1 = std::min(std::ceil(hiy + margin) + 1.0, double(within.y) + within.height);
    if (!(bx1 > bx0 && by1 > by0)) {
        box = Plx_Window{0, 0, 0, 0};
        return true;
    }
    box = Plx_Window{int32_t(bx0), int32_t(by0), int32_t(bx1 - bx0), int32_t(by1 - by0)};
    return true;
}

template <class T>
T *scratch(std::size_t n, const char *caller)
{
    return plx::heap_alloc<T>(n, caller, __FILE__, __LINE__);
}

bool interrupted(const ThreadHostInterface *host)
{
    return host != nullptr && host->interrupt != nullptr && host->interrupt(host->callback_context) != 0;
}

}  // namespace

bool check_call(const WarpCall &call, const char *caller)
{
    auto fail = [&](int32_t code, const char *message, int64_t number) {
        plx_err_flush_trace();
        plx_err_register_fileline(caller, code, __FILE__, __LINE__, message, number);
        return false;
    };
    const Plx_Image *src = call.source;
    if (!supported_format(src->format)) return fail(PLX_ERROR_ILLEGAL_FORMAT, "source format not supported", src->format);
    if (!supported_type(src->format, src->type))
        return fail(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "source pixel type not supported", src->type);
    const bool copying = call.copy_background && call.background != call.output;
    Plx_ImageFormat of = call.output->format;
    Plx_PixelType ot = call.output->type;
    if (copying) {
        const Plx_Image *bg = call.background;
        if (!supported_format(bg->format) || !supported_type(bg->format, bg->type))
            return fail(bg->type == PLX_TYPE_POINTER ? PLX_ERROR_ILLEGAL_PIXEL_TYPE : PLX_ERROR_ILLEGAL_FORMAT,
                        "background cannot be copied into the output", bg->format);
        if (of == PLX_FORMAT_NONE) of = bg->format;
        if (ot == PLX_TYPE_NONE) ot = bg->type;
    }
    if (!supported_format(of)) return fail(PLX_ERROR_ILLEGAL_FORMAT, "output format not supported", of);
    if (!supported_type(of, ot)) return fail(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "output pixel type not supported", ot);
    if (call.output == call.source || (call.output->data != nullptr && call.output->data == src->data))
        return fail(PLX_ERROR_INCOMPATIBLE, "the output cannot be the source", 0);
    const Plx_Image *masks[] = {call.output_mask, call.source_mask != src ? call.source_mask : nullptr,
                                call.params != nullptr ? call.params->window_image : nullptr};
    for (const Plx_Image *m : masks)
        if (m != nullptr && m->type != PLX_TYPE_BIT) return fail(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "mask is not a bit image", m->type);
    if (call.validity != nullptr) {
        if (call.validity->format != PLX_FORMAT_NONE && call.validity->type != PLX_TYPE_BIT)
            return fail(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "validity mask is not a bit image", call.validity->type);
        if (call.validity == call.output_mask || call.validity == call.source_mask)
            return fail(PLX_ERROR_INCOMPATIBLE, "the validity mask must be an image of its own", 0);
    }
    if (call.params == nullptr) return true;
    const ProjectiveWarpParams &p = *call.params;
    if (p.colour_correction != nullptr && (p.colour_correction->mode < 0 || p.colour_correction->mode > 2))
        return fail(PLX_ERROR_ILLEGAL_TYPE, "unknown colour-correction mode", p.colour_correction->mode);
    if (const Plx_Image *d = p.displacement) {
        if (d->format != PLX_FORMAT_VECTOR2D) return fail(PLX_ERROR_ILLEGAL_FORMAT, "displacement is not a 2D field", d->format);
        if (d->type != PLX_TYPE_INT && d->type != PLX_TYPE_FLOAT && d->type != PLX_TYPE_DOUBLE)
            return fail(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "displacement type not supported", d->type);
    }
    if (const Plx_Image *b = p.blur) {
        if (b->type != PLX_TYPE_FLOAT) return fail(PLX_ERROR_ILLEGAL_PIXEL_TYPE, "blur image is not float", b->type);
        if (plx_image_format_channels(b->format) != 3)
            return fail(PLX_ERROR_ILLEGAL_FORMAT, "blur image needs three values per pixel", b->format);
    }
    if (p.fast_render != 0 && (p.displacement != nullptr || p.colour_correction != nullptr))
        return fail(PLX_ERROR_UNSUPPORTED, "fast render takes no displacement or colour correction", 0);
    return true;
}

bool copy_background(const Plx_Image *background, Plx_Image *output, const char *caller)
{
    if (background == output) return true;
    if (plx_image_convert_q(background, output->format, output->type, output) == nullptr) {
        plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "cannot copy the background", 0);
        return false;
    }
    return true;
}

bool init_validity(const Plx_Image *output_mask, bool ignore_mask, const Plx_Image *output, Plx_Image *validity,
                   const char *caller)
{
    if (validity == nullptr) return true;
    bool ok;
    if (output_mask != nullptr && !ignore_mask) {
        ok = plx_image_copy_q(output_mask, validity) != nullptr;
    } else {
        ok = true;
        if (validity->format == PLX_FORMAT_NONE || validity->data == nullptr) {
            ok = plx_image_set_gen(validity, PLX_FORMAT_GREY, PLX_TYPE_BIT, output->height, output->width) != 0;
            if (ok) validity->x = output->x, validity->y = output->y;
        }
        const double one = 1.0;
        ok = ok && plx_image_fill_const(validity, &one) != 0;
    }
    if (!ok) plx_err_register_fileline(caller, PLX_ERROR_CALLEE, __FILE__, __LINE__, "cannot set up the validity mask", 0);
    return ok;
}

bool render(Context &ctx, const char *caller)
{
    const int32_t n = ctx.region.width;
    const std::size_t un = std::size_t(n);
    plx::HeapPtr<float> px(scratch<float>(un, caller)), py(scratch<float>(un, caller));
    plx::HeapPtr<uint8_t> status(scratch<uint8_t>(un, caller));
    plx::HeapPtr<float> pixels(scratch<float>(un * 4, caller)), coverage(scratch<float>(un, caller));
    plx::HeapPtr<float> converted(scratch<float>(un * 4, caller));
    plx::HeapPtr<TileMap> tiles(ctx.fast_render ? scratch<TileMap>(un / std::size_t(ctx.tile) + 2, caller) : nullptr);
    if (!px || !py || !status || !pixels || !coverage || !converted || (ctx.fast_render && !tiles)) return false;
    ctx.tiles = tiles.get();
    RowBuffers rb{px.get(), py.get(), status.get(), pixels.get(), coverage.get(), converted.get()};

    const SampleRowFn sample = ctx.high_quality ? high_quality_sampler(ctx.source) : bilinear_sampler(ctx.source);
    const bool convert = ctx.source->format != ctx.output->format || ctx.correction.mode >= 0;
    const ConvertRowFn conv = convert ? converter(ctx.source->format, ctx.output->format) : nullptr;
    const StoreRowFn store = storer(ctx.output);
    if (sample == nullptr || store == nullptr || (convert && conv == nullptr)) {
        plx_err_flush_trace();
        plx_err_register_fileline(caller, PLX_ERROR_ILLEGAL_FORMAT, __FILE__, __LINE__, "pixel format not supported", 0);
        return false;
    }
    const ThreadHostInterface *host = ctx.host;
    const bool progress = ctx.report_progress && host != nullptr && host->progress != nullptr;
    const Plx_Window full = ctx.region;
    auto run_row = [&](int32_t y, int32_t x0, int32_t w) {
        ctx.region.x = x0;
        ctx.region.width = w;
        if (!(ctx.fast_render ? map_row_tiles(ctx, y, rb, caller) : map_row(ctx, y, rb, caller))) return false;
        sample(ctx, y, rb);
        if (conv != nullptr)
            conv(ctx.correction, w, rb.status, rb.pixels, ctx.high_quality ? rb.coverage : nullptr, rb.converted);
        store(ctx.output, y - ctx.output->y, x0 - ctx.output->x, w, rb.status,
              conv != nullptr ? rb.converted : rb.pixels);
        Plx_Image *validity = ctx.validity;
        uint64_t written = 0;
        if (validity == nullptr) {
            for (int32_t i = 0; i < w; ++i) written += rb.status[i] == kWrite || rb.status[i] == kWriteInvalid;
        } else {
            const int32_t vr = y - validity->y, vc = x0 - validity->x;
            for (int32_t i = 0; i < w; ++i) {
                const uint8_t s = rb.status[i];
                written += s == kWrite || s == kWriteInvalid;
                if (s == kWriteInvalid || s == kInvalid) clear_bit(validity, vr, vc + i);
            }
        }
        ctx.written += written;
        return true;
    };
    // The fast render's bands are its rows of tiles.
    const int32_t rows = full.height, T = ctx.tile;
    for (int32_t b0 = 0; b0 < rows;) {
        int32_t b1;
        if (ctx.fast_render) {
            const int32_t y = full.y + b0;
            const int32_t tile_end = (floor_div(y, T) + 1) * T;
            b1 = std::min(rows, b0 + (tile_end - y));
        } else {
            b1 = std::min(rows, b0 + kBandRows);
        }
        // Row by row the interrupt is asked during the band's first strip; an answer at row r
        // cuts the band after r, so the other strips finish exactly the rows up to r.
        bool stop = false;
        for (int32_t sx = 0; sx < full.width; sx += kStripWidth) {
            const int32_t w = std::min(kStripWidth, full.width - sx);
            ctx.tiles_valid = false;
            for (int32_t r = b0; r < b1; ++r) {
                if (!run_row(full.y + r, full.x + sx, w)) {
                    ctx.region = full;
                    return false;
                }
                if (sx == 0 && !ctx.fast_render && interrupted(host)) {
                    b1 = r + 1;
                    stop = true;
                }
            }
        }
        ctx.region = full;
        if (stop || (ctx.fast_render && interrupted(host))) return true;
        if (progress) {
            if (ctx.fast_render) {
                const int32_t tile_row = floor_div(full.y + b0, T) - floor_div(full.y, T);
                if (tile_row % 5 == 0) host->progress(host->callback_context, int32_t(int64_t(tile_row) * T * 50 / rows));
            } else {
                for (int32_t r = b0; r < b1; ++r)
                    if (r % kProgressRows == 0) host->progress(host->callback_context, int32_t(int64_t(r) * 100 / rows));
            }
        }
        b0 = b1;
    }
    return true;
}

bool warp(const WarpCall &call, const char *caller)
{
    if (call.background == nullptr || call.source == nullptr || call.output == nullptr) {
        PLX_ERR_START_AS(caller, PLX_ERROR_ILLEGAL_ARGUMENT, "null background, source or output", 0);
        return false;
    }
    const Plx_Image *bg = call.background, *src = call.source;
    if (bg->width <= 0 || bg->height <= 0 || src->width <= 0 || src->height <= 0) return true;
    ProjectiveWarpParams p;
    if (call.params != nullptr)
        p = *call.params;
    else
        vInitProjectiveWarpParams(&p);
    if (!check_call(call, caller)) return false;

    Context ctx;
    if (!build_mapping(call.camera_a, call.homography, call.camera_b, ctx.map, caller)) return false;
    if (call.copy_background && !copy_background(bg, call.output, caller)) return false;
    const bool use_output_mask = call.output_mask != nullptr && p.ignore_output_mask == 0;
    if (call.init_validity &&
        !init_validity(call.output_mask, p.ignore_output_mask != 0, call.output, call.validity, caller))
        return false;

    // The requested output region: the output mask's, else the background's, within the
    // window and the output image.
    Plx_Window req;
    if (use_output_mask) {
        if (!active_frame_window(call.output_mask, req, caller)) return false;
    } else {
        req = frame_extent(bg);
    }
    if (p.window_width > 0) req = plx_window_intersect(req, Plx_Window{p.window_x, p.window_y, p.window_width, p.window_height});
    if (!empty(req)) req = plx_window_intersect(req, frame_extent(call.output));
    if (empty(req)) return true;

    // Where the source can be sampled.
    const Plx_Image *source_mask = call.source_mask != src ? call.source_mask : nullptr;
    Plx_Window srcw;
    if (p.window_image != nullptr) {
        if (!active_frame_window(p.window_image, srcw, caller)) return false;
    } else if (source_mask != nullptr) {
        if (!active_frame_window(source_mask, srcw, caller)) return false;
    } else {
        srcw = frame_extent(src);
    }
    if (!empty(srcw)) srcw = plx_window_intersect(srcw, frame_extent(src));
    if (empty(srcw)) {
        clear_validity(call.validity, req);
        return true;
    }

    // Pixels that cannot receive a sample are never visited. A blur or a displacement can
    // reach beyond the projected source, so they keep the whole region.
    Plx_Window region = req;
    Plx_Window box;
    if (p.blur == nullptr && p.displacement == nullptr && projected_box(ctx.map, srcw, req, box))
        region = empty(box) ? box : plx_window_intersect(req, box);
    clear_validity_outside(call.validity, req, region);
    if (empty(region)) return true;

    ctx.source = src;
    ctx.source_mask = source_mask;
    ctx.window_image = p.window_image;
    ctx.output = call.output;
    ctx.output_mask = use_output_mask ? call.output_mask : nullptr;
    ctx.validity = call.validity;
    ctx.displacement = p.displacement;
    ctx.blur = p.blur;
    ctx.region = region;
    ctx.border_fill = p.border_fill != 0;
    ctx.high_quality = p.high_quality_fill != 0;
    ctx.fast_render = p.fast_render != 0;
    ctx.tile = p.tile_size == 0 ? kDefaultTile : int32_t(std::min(p.tile_size, kMaxTile));
    ctx.alpha_weighting = p.alpha_weighting != 0;
    ctx.inverse_alpha = p.inverse_alpha != 0;
    ctx.divide_by_alpha = p.divide_by_alpha != 0;
    if (p.colour_correction != nullptr) {
        ctx.correction.mode = p.colour_correction->mode;
        for (int i = 0; i < 12; ++i) ctx.correction.c[i] = float(p.colour_correction->coefficients[i]);
    }
    ctx.host = call.host;
    ctx.report_progress = call.report_progress;
    const bool ok = render(ctx, caller);
    if (call.statistics != nullptr) *call.statistics += uint32_t(ctx.written);
    return ok;
}

}  // namespace plano::warp

extern "C" {

PLANO_API void vInitProjectiveWarpParams(ProjectiveWarpParams *params)
{
    if (params != nullptr) std::memset(params, 0, sizeof *params);
}

PLANO_API Plx_Bool bImageProjectiveWarp(const Plx_Image *background, const Plx_Image *output_mask,
                                        const Plx_Camera *camera_a, const Plx_Image *source,
                                        const Plx_Image *source_mask, const Plx_Camera *camera_b,
                                        const Plx_Matrix33 *homography, const ProjectiveWarpParams *params,
                                        Plx_Image *output, Plx_Image *validity, const ThreadHostInterface *host,
                                        uint32_t *statistics, Plx_Bool copy_background)
{
    const plano::warp::WarpCall call{background, output_mask, camera_a, source, source_mask, camera_b,
                                     homography, params, output, validity, host, statistics,
                                     copy_background != 0, true, true};
    return plano::warp::warp(call, __func__) ? 1 : 0;
}

PLANO_API Plx_Bool pfncImageProjectiveWarp(void *job_record)
{
    auto *job = static_cast<ProjectiveWarpJob *>(job_record);
    if (job == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null job", 0);
        return 0;
    }
    if (!bImageProjectiveWarp(job->background, job->output_mask, job->camera_a, job->source, job->source_mask,
                              job->camera_b, job->homography, &job->params, job->output, job->validity, job->host,
                              job->statistics, 1)) {
        PLX_ERR_PASS();
        return 0;
    }
    return 1;
}

}  // extern "C"
