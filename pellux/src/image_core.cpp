// Forming, re-setting, freeing, copying and viewing images.
#include <algorithm>
#include <cstdlib>
#include <cstring>

#include <sys/mman.h>

#include "image_internal.hpp"
#include "image_ops.hpp"
#include "pellux/detail/util.hpp"

namespace plx {

bool valid_format_type(Plx_ImageFormat format, Plx_PixelType type)
{
    switch (format) {
    case PLX_FORMAT_GREY:
        return type >= PLX_TYPE_BIT && type <= PLX_TYPE_DOUBLE;
    case PLX_FORMAT_GREY_ALPHA:
    case PLX_FORMAT_RGB:
    case PLX_FORMAT_RGBA:
    case PLX_FORMAT_BGR:
    case PLX_FORMAT_BGRA:
    case PLX_FORMAT_VECTOR2D:
    case PLX_FORMAT_VECTOR3D:
        return type >= PLX_TYPE_UCHAR && type <= PLX_TYPE_DOUBLE;
    case PLX_FORMAT_POINTER:
        return type == PLX_TYPE_POINTER;
    default:
        return false;
    }
}

bool check_format_type(Plx_ImageFormat format, Plx_PixelType type, const char *function)
{
    if (format < PLX_FORMAT_GREY || format > PLX_FORMAT_POINTER) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_FORMAT, "unknown image format", format);
        return false;
    }
    if (!valid_format_type(format, type)) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_PIXEL_TYPE,
                         "pixel type not available in this format", type);
        return false;
    }
    return true;
}

bool window_inside(const Plx_Image *image, Plx_Window w)
{
    return w.x >= 0 && w.y >= 0 && w.width >= 0 && w.height >= 0 &&
           static_cast<int64_t>(w.x) + w.width <= image->width &&
           static_cast<int64_t>(w.y) + w.height <= image->height;
}

}  // namespace plx

namespace {

void free_image_contents(Plx_Image *image)
{
    std::free(image->block);
    image->block = nullptr;
    image->block_size = 0;
    image->data = nullptr;
    if (image->owned) std::free(image);
}

// Allocates pixel memory for the record's current size, format and type, reusing its own
// block when large enough. Registers code 5 under function on failure.
bool allocate_pixels(Plx_Image *image, const char *function)
{
    std::size_t bytes = static_cast<std::size_t>(image->stride) * static_cast<std::size_t>(image->height);
    if (bytes == 0) {
        image->data = image->block;
        return true;
    }
    if (image->block == nullptr || image->block_size < bytes) {
        // Blocks start on a cache line: vector loads of row 0 then never straddle two lines,
        // and row-major passes over narrow columns touch fewer lines.
        // Large blocks go on huge pages where the system offers them: a pass down narrow
        // columns touches one row per small page, more pages than the TLB holds.
        constexpr std::size_t huge = std::size_t(2) << 20;
        const bool large = bytes >= 2 * huge;
        void *block = nullptr;
        if (posix_memalign(&block, large ? huge : 64, bytes) != 0) {
            plx_err_flush_trace();
            plx_err_register_fileline(function, PLX_ERROR_MALLOC_FAILED, __FILE__, __LINE__, "",
                                      static_cast<int64_t>(bytes));
            return false;
        }
#ifdef MADV_HUGEPAGE
        if (large) madvise(block, bytes / huge * huge, MADV_HUGEPAGE);  // advice only; failure is harmless
#endif
        std::free(image->block);
        image->block = block;
        image->block_size = bytes;
    }
    image->data = image->block;
    // Bit rows end in padding bits that whole-word readers (counts, logic, run coding) take
    // as pixels; they start zero, and every writer leaves them so.
    if (image->type == PLX_TYPE_BIT) std::memset(image->data, 0, bytes);
    return true;
}

bool check_sizes(int32_t height, int32_t width, const char *function)
{
    if (height < 0 || width < 0) {
        PLX_ERR_START_AS(function, PLX_ERROR_ILLEGAL_ARGUMENT, "negative image size",
                         height < 0 ? height : width);
        return false;
    }
    return true;
}

}  // namespace

extern "C" {

PLX_API Plx_Window plx_window_intersect(Plx_Window a, Plx_Window b)
{
    int64_t x0 = a.x > b.x ? a.x : b.x;
    int64_t y0 = a.y > b.y ? a.y : b.y;
    int64_t x1 = std::min<int64_t>(static_cast<int64_t>(a.x) + a.width, static_cast<int64_t>(b.x) + b.width);
    int64_t y1 = std::min<int64_t>(static_cast<int64_t>(a.y) + a.height, static_cast<int64_t>(b.y) + b.height);
    Plx_Window r{static_cast<int32_t>(x0), static_cast<int32_t>(y0), 0, 0};
    if (x1 > x0 && y1 > y0 && a.width > 0 && a.height > 0 && b.width > 0 && b.height > 0) {
        r.width = static_cast<int32_t>(x1 - x0);
        r.height = static_cast<int32_t>(y1 - y0);
    }
    return r;
}

PLX_API uint32_t plx_image_format_channels(Plx_ImageFormat format)
{
    switch (format) {
    case PLX_FORMAT_GREY: return 1;
    case PLX_FORMAT_GREY_ALPHA: return 2;
    case PLX_FORMAT_RGB: return 3;
    case PLX_FORMAT_RGBA: return 4;
    case PLX_FORMAT_BGR: return 3;
    case PLX_FORMAT_BGRA: return 4;
    case PLX_FORMAT_VECTOR2D: return 2;
    case PLX_FORMAT_VECTOR3D: return 3;
    case PLX_FORMAT_POINTER: return 1;
    default: return 0;
    }
}

PLX_API uint32_t plx_image_type_size(Plx_PixelType type)
{
    switch (type) {
    case PLX_TYPE_UCHAR: return 1;
    case PLX_TYPE_USHORT: return 2;
    case PLX_TYPE_INT: return 4;
    case PLX_TYPE_UINT: return 4;
    case PLX_TYPE_FLOAT: return 4;
    case PLX_TYPE_DOUBLE: return 8;
    case PLX_TYPE_POINTER: return sizeof(void *);
    default: return 0;
    }
}

PLX_API int32_t plx_image_min_stride(Plx_ImageFormat format, Plx_PixelType type, int32_t width)
{
    if (width <= 0) return 0;
    int64_t bytes;
    if (type == PLX_TYPE_BIT)
        bytes = ((static_cast<int64_t>(width) + 31) / 32) * 4;
    else
        bytes = static_cast<int64_t>(width) * plx_image_format_channels(format) * plx_image_type_size(type);
    return bytes > INT32_MAX ? -1 : static_cast<int32_t>(bytes);
}

PLX_API Plx_Image *plx_image_form_gen(Plx_Image *image, Plx_ImageFormat format,
                                      Plx_PixelType type, int32_t height, int32_t width)
{
    if (!plx::check_format_type(format, type, __func__) || !check_sizes(height, width, __func__))
        return nullptr;
    int32_t stride = plx_image_min_stride(format, type, width);
    if (stride < 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "image row too large", width);
        return nullptr;
    }
    bool owned = false;
    if (image == nullptr) {
        image = PLX_ALLOC(Plx_Image, 1);
        if (image == nullptr) return nullptr;
        owned = true;
    }
    *image = Plx_Image{};
    image->format = format;
    image->type = type;
    image->height = height;
    image->width = width;
    image->stride = stride;
    image->owned = owned ? 1u : 0u;
    image->free_func = free_image_contents;
    if (!allocate_pixels(image, __func__)) {
        if (owned) std::free(image);
        return nullptr;
    }
    return image;
}

PLX_API Plx_Bool plx_image_set_gen(Plx_Image *image, Plx_ImageFormat format, Plx_PixelType type,
                                   int32_t height, int32_t width)
{
    if (image == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null image", 0);
        return 0;
    }
    if (!plx::check_format_type(format, type, __func__) || !check_sizes(height, width, __func__))
        return 0;
    bool is_view = image->block == nullptr && image->data != nullptr;
    if (is_view) {
        if (image->format == format && image->type == type && image->height == height &&
            image->width == width)
            return 1;
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "a view of another image cannot be re-set", 0);
        return 0;
    }
    int32_t stride = plx_image_min_stride(format, type, width);
    if (stride < 0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "image row too large", width);
        return 0;
    }
    Plx_Image updated = *image;
    updated.format = format;
    updated.type = type;
    updated.height = height;
    updated.width = width;
    updated.stride = stride;
    if (updated.free_func == nullptr) updated.free_func = free_image_contents;
    if (!allocate_pixels(&updated, __func__)) return 0;
    *image = updated;
    return 1;
}

PLX_API void plx_image_free(Plx_Image *image)
{
    if (image == nullptr) return;
    if (image->free_func != nullptr)
        image->free_func(image);
    else if (image->owned)
        std::free(image);
}

PLX_API Plx_Image *plx_image_copy_q(const Plx_Image *source, Plx_Image *dest)
{
    if (source == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null source", 0);
        return nullptr;
    }
    Plx_Window all{0, 0, source->width, source->height};
    Plx_Image *r = plx_image_extract_q(source, all, source->format, source->type, 1, dest);
    if (r == nullptr) {
        PLX_ERR_PASS();
        return nullptr;
    }
    r->x = source->x;
    r->y = source->y;
    return r;
}

PLX_API Plx_Image *plx_image_extract_q(const Plx_Image *source, Plx_Window window,
                                       Plx_ImageFormat format, Plx_PixelType type,
                                       Plx_Bool copy, Plx_Image *dest)
{
    if (!plx::check_image(source, __func__)) return nullptr;
    if (dest == source) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "dest is the source", 0);
        return nullptr;
    }
    // dest's own pixels are released or rewritten below: they must not be the ones being read.
    if (dest != nullptr && dest->block != nullptr && source->data != nullptr &&
        static_cast<const char *>(source->data) >= static_cast<const char *>(dest->block) &&
        static_cast<const char *>(source->data) < static_cast<const char *>(dest->block) + dest->block_size) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "dest holds the source's pixels", 0);
        return nullptr;
    }
    if (!plx::window_inside(source, window)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "window outside the image", 0);
        return nullptr;
    }
    if (format == PLX_FORMAT_NONE) format = source->format;
    if (type == PLX_TYPE_NONE) type = source->type;

    if (!copy) {
        if (format != source->format || type != source->type) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "a view cannot convert pixels", 0);
            return nullptr;
        }
        if (type == PLX_TYPE_BIT && window.x % 32 != 0) {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "bit view must start on a word", window.x);
            return nullptr;
        }
        bool owned = false;
        if (dest == nullptr) {
            dest = PLX_ALLOC(Plx_Image, 1);
            if (dest == nullptr) return nullptr;
            owned = true;
        } else {
            // A view owns no pixels: release the ones dest held, but keep the record itself
            // (and whether it came from the heap) as the caller made it.
            owned = dest->owned != 0;
            std::free(dest->block);
        }
        *dest = *source;
        dest->block = nullptr;
        dest->block_size = 0;
        dest->owned = owned ? 1u : 0u;
        dest->free_func = free_image_contents;
        dest->height = window.height;
        dest->width = window.width;
        dest->x = source->x + window.x;
        dest->y = source->y + window.y;
        std::size_t col_bytes = type == PLX_TYPE_BIT
                                    ? static_cast<std::size_t>(window.x / 32) * 4
                                    : static_cast<std::size_t>(window.x) *
                                          plx_image_format_channels(format) * plx_image_type_size(type);
        dest->data = (window.width == 0 || window.height == 0 || source->data == nullptr)
                         ? nullptr
                         : static_cast<char *>(plx_image_row(source, window.y)) + col_bytes;
        return dest;
    }

    // Refuse an impossible conversion before dest is touched.
    if (!plx::check_conversion(source->format, source->type, format, type, __func__)) return nullptr;
    bool owned = dest == nullptr;
    if (owned) {
        dest = plx_image_form_gen(nullptr, format, type, window.height, window.width);
        if (dest == nullptr) {
            PLX_ERR_PASS();
            return nullptr;
        }
    } else {
        // A view is dropped (it owns nothing) and dest gets pixels of its own; the record
        // changes only once that has succeeded.
        Plx_Image updated = *dest;
        if (updated.block == nullptr && updated.data != nullptr) {
            updated = Plx_Image{};
            updated.owned = dest->owned;
        }
        if (!plx_image_set_gen(&updated, format, type, window.height, window.width)) {
            PLX_ERR_PASS();
            return nullptr;
        }
        *dest = updated;
    }
    if (!plx::copy_window_converted(source, window, dest)) {
        PLX_ERR_PASS();
        if (owned) plx_image_free(dest);
        return nullptr;
    }
    dest->x = source->x + window.x;
    dest->y = source->y + window.y;
    return dest;
}

#define PLX_DEFINE_SHORTHAND(fmt, ty, FORMAT, TYPE)                                            \
    PLX_API Plx_Image *plx_image_form_gen_##fmt##_##ty(Plx_Image *image, int32_t height,        \
                                                       int32_t width)                          \
    {                                                                                          \
        return plx_image_form_gen(image, FORMAT, TYPE, height, width);                         \
    }
#define PLX_DEFINE_SHORTHANDS(fmt, FORMAT)                                                     \
    PLX_DEFINE_SHORTHAND(fmt, uc, FORMAT, PLX_TYPE_UCHAR)                                      \
    PLX_DEFINE_SHORTHAND(fmt, us, FORMAT, PLX_TYPE_USHORT)                                     \
    PLX_DEFINE_SHORTHAND(fmt, i, FORMAT, PLX_TYPE_INT)                                         \
    PLX_DEFINE_SHORTHAND(fmt, ui, FORMAT, PLX_TYPE_UINT)                                       \
    PLX_DEFINE_SHORTHAND(fmt, f, FORMAT, PLX_TYPE_FLOAT)                                       \
    PLX_DEFINE_SHORTHAND(fmt, d, FORMAT, PLX_TYPE_DOUBLE)
PLX_DEFINE_SHORTHANDS(gl, PLX_FORMAT_GREY)
PLX_DEFINE_SHORTHANDS(gla, PLX_FORMAT_GREY_ALPHA)
PLX_DEFINE_SHORTHANDS(rgb, PLX_FORMAT_RGB)
PLX_DEFINE_SHORTHANDS(rgba, PLX_FORMAT_RGBA)
PLX_DEFINE_SHORTHANDS(bgr, PLX_FORMAT_BGR)
PLX_DEFINE_SHORTHANDS(bgra, PLX_FORMAT_BGRA)
PLX_DEFINE_SHORTHANDS(v2, PLX_FORMAT_VECTOR2D)
PLX_DEFINE_SHORTHANDS(v3, PLX_FORMAT_VECTOR3D)

PLX_API Plx_Image *plx_image_form_gen_b(Plx_Image *image, int32_t height, int32_t width)
{
    return plx_image_form_gen(image, PLX_FORMAT_GREY, PLX_TYPE_BIT, height, width);
}

PLX_API Plx_Image *plx_image_form_gen_p(Plx_Image *image, int32_t height, int32_t width)
{
    return plx_image_form_gen(image, PLX_FORMAT_POINTER, PLX_TYPE_POINTER, height, width);
}

}  // extern "C"
