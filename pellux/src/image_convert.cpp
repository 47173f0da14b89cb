// Converting pixels between formats and pixel types: the row converter every copying
// operation goes through, window copies, channel extraction and whole-image conversion.
#include <array>
#include <cfloat>
#include <cmath>
#include <cstring>
#include <limits>

#include "image_internal.hpp"
#include "image_ops.hpp"
#include "pellux/detail/pixel_traits.hpp"

namespace plx {

namespace {

// Tag of the bit pixel type for the templates below.
struct Bit {};

// Calls f(T{}) for the C++ type of any value-carrying pixel type, bits included.
template <class F>
void dispatch_value_type(Plx_PixelType type, F &&f)
{
    if (type == PLX_TYPE_BIT)
        f(Bit{});
    else
        dispatch_numeric_type(type, f);
}

// Full scale of a type, and whether conversions rescale it (see image.h).
double type_scale(Plx_PixelType t)
{
    double s = 1.0;
    dispatch_numeric_type(t, [&](auto v) { s = PixelTraits<decltype(v)>::scale; });
    return s;
}
bool type_normalised(Plx_PixelType t)
{
    bool n = true;  // bits: 1 is full scale, like the floating types
    dispatch_numeric_type(t, [&](auto v) { n = PixelTraits<decltype(v)>::normalised; });
    return n;
}

template <class T>
void unpack(const void *row, int32_t col, int32_t n, uint32_t channels, double *out)
{
    if constexpr (std::is_same_v<T, Bit>) {
        (void)channels;
        const uint32_t *w = static_cast<const uint32_t *>(row);
        for (int32_t i = 0; i < n; ++i) out[i] = get_bit(w, int64_t{col} + i) ? 1.0 : 0.0;
    } else {
        const T *p = static_cast<const T *>(row) + static_cast<std::size_t>(col) * channels;
        std::size_t m = static_cast<std::size_t>(n) * channels;
        for (std::size_t i = 0; i < m; ++i) out[i] = static_cast<double>(p[i]);
    }
}

template <class T>
void pack(const double *in, double num, double den, int32_t n, uint32_t channels, void *row, int32_t col)
{
    if constexpr (std::is_same_v<T, Bit>) {
        (void)channels;
        // A bit is the value rounded to 0 or 1: set from half of full scale upwards.
        uint32_t *w = static_cast<uint32_t *>(row);
        int32_t i = 0;
        while (i < n) {
            int64_t pos = int64_t{col} + i;
            int32_t count = 32 - static_cast<int32_t>(pos & 31);
            if (count > n - i) count = n - i;
            uint32_t bits = 0;
            for (int32_t k = 0; k < count; ++k)
                bits |= static_cast<uint32_t>(in[i + k] * num / den >= 0.5) << k;
            put_bits(w, pos, bits, count);
            i += count;
        }
    } else {
        T *p = static_cast<T *>(row) + static_cast<std::size_t>(col) * channels;
        std::size_t m = static_cast<std::size_t>(n) * channels;
        // Multiplying before dividing keeps exact what can be: 51 / 255 is the double
        // nearest 0.2, which 51 * (1 / 255) is not.
        if (num == den) {
            for (std::size_t i = 0; i < m; ++i) p[i] = saturate<T>(in[i]);
        } else {
            for (std::size_t i = 0; i < m; ++i) p[i] = saturate<T>(in[i] * num / den);
        }
    }
}

// Where each role sits in a format's pixel; -1 when the format has no such channel.
struct Layout {
    int8_t grey = -1, alpha = -1, r = -1, g = -1, b = -1;
    int8_t vec = 0;  // components of a vector field
};

Layout layout_of(Plx_ImageFormat f)
{
    Layout l;
    switch (f) {
    case PLX_FORMAT_GREY: l.grey = 0; break;
    case PLX_FORMAT_GREY_ALPHA: l.grey = 0; l.alpha = 1; break;
    case PLX_FORMAT_RGB: l.r = 0; l.g = 1; l.b = 2; break;
    case PLX_FORMAT_RGBA: l.r = 0; l.g = 1; l.b = 2; l.alpha = 3; break;
    case PLX_FORMAT_BGR: l.b = 0; l.g = 1; l.r = 2; break;
    case PLX_FORMAT_BGRA: l.b = 0; l.g = 1; l.r = 2; l.alpha = 3; break;
    case PLX_FORMAT_VECTOR2D: l.vec = 2; break;
    case PLX_FORMAT_VECTOR3D: l.vec = 3; break;
    default: break;
    }
    return l;
}

// Rec. 709 weights, the same as plx_rgb_to_luminance.
constexpr double kLumaR = 0.2126, kLumaG = 0.7152, kLumaB = 0.0722;

}  // namespace

void RowConverter::set_types(Plx_PixelType st, Plx_PixelType dt)
{
    dispatch_value_type(st, [&](auto v) { unpack_ = &unpack<decltype(v)>; });
    dispatch_value_type(dt, [&](auto v) { pack_ = &pack<decltype(v)>; });
    if (type_normalised(st) && type_normalised(dt)) {
        num_ = type_scale(dt);
        den_ = type_scale(st);
    }
}

RowConverter::RowConverter(const Plx_Image *source, const Plx_Image *dest)
{
    set_types(source->type, dest->type);
    src_channels_ = plx_image_format_channels(source->format);
    dst_channels_ = plx_image_format_channels(dest->format);
    identity_ = source->format == dest->format;
    if (identity_) return;
    Layout s = layout_of(source->format), d = layout_of(dest->format);
    bool s_colour = s.r >= 0;
    // The missing alpha is the destination's full scale, expressed in source units because
    // the packing step rescales every value by num_ / den_.
    double full = type_scale(dest->type) * den_ / num_;
    for (uint32_t c = 0; c < dst_channels_; ++c) {
        Op &op = op_[c];
        int8_t ch = static_cast<int8_t>(c);
        op.kind = 0;
        if (d.vec > 0) {
            if (ch < s.vec) op.src = ch;
            else { op.kind = 2; op.value = 0.0; }
        } else if (ch == d.alpha) {
            if (s.alpha >= 0) op.src = s.alpha;
            else { op.kind = 2; op.value = full; }
        } else if (ch == d.grey) {
            if (s.grey >= 0) op.src = s.grey;
            else { op.kind = 1; op.r = s.r; op.g = s.g; op.b = s.b; }
        } else {
            int8_t same = ch == d.r ? s.r : ch == d.g ? s.g : s.b;
            op.src = s_colour ? same : s.grey;
        }
    }
}

RowConverter::RowConverter(const Plx_Image *source, uint32_t channel, const Plx_Image *dest)
{
    set_types(source->type, dest->type);
    src_channels_ = plx_image_format_channels(source->format);
    dst_channels_ = 1;
    identity_ = src_channels_ == 1;
    op_[0].kind = 0;
    op_[0].src = static_cast<int8_t>(channel);
}

void RowConverter::convert(const Plx_Image *source, int32_t sr, int32_t sc, Plx_Image *dest,
                           int32_t dr, int32_t dc, int32_t n, double *scratch) const
{
    double *in = scratch;
    double *out = scratch + 4 * static_cast<std::size_t>(n);
    unpack_(plx_image_row(source, sr), sc, n, src_channels_, in);
    const double *result = in;
    if (!identity_) {
        const uint32_t si = src_channels_, di = dst_channels_;
        for (uint32_t c = 0; c < di; ++c) {
            const Op &op = op_[c];
            double *o = out + c;
            if (op.kind == 0) {
                const double *p = in + op.src;
                for (int32_t i = 0; i < n; ++i) o[i * di] = p[i * si];
            } else if (op.kind == 1) {
                const double *pr = in + op.r, *pg = in + op.g, *pb = in + op.b;
                for (int32_t i = 0; i < n; ++i)
                    o[i * di] = kLumaR * pr[i * si] + kLumaG * pg[i * si] + kLumaB * pb[i * si];
            } else {
                for (int32_t i = 0; i < n; ++i) o[i * di] = op.value;
            }
        }
        result = out;
    }
    pack_(result, num_, den_, n, dst_channels_, plx_image_row(dest, dr), dc);
}

bool copy_window_converted(const Plx_Image *source, Plx_Window window, Plx_Image *dest)
{
    if (window.width <= 0 || window.height <= 0) return true;
    if (source->format == dest->format && source->type == dest->type) {
        if (source->type == PLX_TYPE_BIT) {
            for (int32_t r = 0; r < window.height; ++r)
                copy_bits(bit_row(source, window.y + r), window.x, bit_row(dest, r), 0, window.width);
            return true;
        }
        std::size_t px = static_cast<std::size_t>(plx_image_format_channels(source->format)) *
                         plx_image_type_size(source->type);
        for (int32_t r = 0; r < window.height; ++r)
            std::memcpy(plx_image_row(dest, r),
                        static_cast<const char *>(plx_image_row(source, window.y + r)) + window.x * px,
                        static_cast<std::size_t>(window.width) * px);
        return true;
    }
    // Rows go through a fixed scratch in chunks, so conversion never needs the heap.
    constexpr int32_t kChunk = 256;
    std::array<double, 8 * kChunk> scratch;
    RowConverter conv(source, dest);
    for (int32_t r = 0; r < window.height; ++r)
        for (int32_t c = 0; c < window.width; c += kChunk) {
            int32_t n = window.width - c < kChunk ? window.width - c : kChunk;
            conv.convert(source, window.y + r, window.x + c, dest, r, c, n, scratch.data());
        }
    return true;
}

}  // namespace plx

extern "C" {

PLX_API Plx_Image *plx_image_extract_channel_q(const Plx_Image *source, uint32_t channel,
                                               Plx_PixelType type, Plx_Image *dest)
{
    if (!plx::check_value_image(source, __func__)) return nullptr;
    if (channel >= plx_image_format_channels(source->format)) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "no such channel", channel);
        return nullptr;
    }
    if (type == PLX_TYPE_NONE) type = source->type;
    if (!plx::check_format_type(PLX_FORMAT_GREY, type, __func__)) return nullptr;
    if (dest == source) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "dest is the source", 0);
        return nullptr;
    }
    bool made;
    Plx_Image *out = plx::acquire_dest(dest, PLX_FORMAT_GREY, type, source->height, source->width,
                                       __func__, made);
    if (out == nullptr) return nullptr;
    constexpr int32_t kChunk = 256;
    std::array<double, 8 * kChunk> scratch;
    plx::RowConverter conv(source, channel, out);
    for (int32_t r = 0; r < source->height; ++r)
        for (int32_t c = 0; c < source->width; c += kChunk) {
            int32_t n = source->width - c < kChunk ? source->width - c : kChunk;
            conv.convert(source, r, c, out, r, c, n, scratch.data());
        }
    out->x = source->x;
    out->y = source->y;
    return out;
}

PLX_API Plx_Image *plx_image_convert_q(const Plx_Image *source, Plx_ImageFormat format,
                                       Plx_PixelType type, Plx_Image *dest)
{
    if (!plx::check_image(source, __func__)) return nullptr;
    if (format == PLX_FORMAT_NONE) format = source->format;
    if (type == PLX_TYPE_NONE) type = source->type;
    if (!plx::check_conversion(source->format, source->type, format, type, __func__)) return nullptr;
    if (dest == source) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "dest is the source", 0);
        return nullptr;
    }
    bool made;
    Plx_Image *out = plx::acquire_dest(dest, format, type, source->height, source->width, __func__, made);
    if (out == nullptr) return nullptr;
    plx::copy_window_converted(source, Plx_Window{0, 0, source->width, source->height}, out);
    out->x = source->x;
    out->y = source->y;
    return out;
}

}  // extern "C"
