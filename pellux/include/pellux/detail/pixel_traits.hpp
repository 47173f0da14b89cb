// Pixel types and formats as compile-time traits, and the one switch that turns a runtime
// type code into a call of a template instantiated for it.
#ifndef PELLUX_DETAIL_PIXEL_TRAITS_HPP
#define PELLUX_DETAIL_PIXEL_TRAITS_HPP

#include <cstdint>
#include <limits>
#include <type_traits>

#include "pellux/image.h"

namespace plx {

template <class T>
struct PixelTraits;

// scale: the value standing for full intensity (1.0) for normalised types; 1 for plain ones.
// normalised: conversions to and from the floating types rescale by `scale`.
template <>
struct PixelTraits<uint8_t> {
    static constexpr Plx_PixelType code = PLX_TYPE_UCHAR;
    static constexpr double scale = 255.0;
    static constexpr bool normalised = true;
    static constexpr bool integral = true;
    using Accum = float;
};
template <>
struct PixelTraits<uint16_t> {
    static constexpr Plx_PixelType code = PLX_TYPE_USHORT;
    static constexpr double scale = 65535.0;
    static constexpr bool normalised = true;
    static constexpr bool integral = true;
    using Accum = float;
};
template <>
struct PixelTraits<int32_t> {
    static constexpr Plx_PixelType code = PLX_TYPE_INT;
    static constexpr double scale = 1.0;
    static constexpr bool normalised = false;
    static constexpr bool integral = true;
    using Accum = double;
};
template <>
struct PixelTraits<uint32_t> {
    static constexpr Plx_PixelType code = PLX_TYPE_UINT;
    static constexpr double scale = 1.0;
    static constexpr bool normalised = false;
    static constexpr bool integral = true;
    using Accum = double;
};
template <>
struct PixelTraits<float> {
    static constexpr Plx_PixelType code = PLX_TYPE_FLOAT;
    static constexpr double scale = 1.0;
    static constexpr bool normalised = true;
    static constexpr bool integral = false;
    using Accum = float;
};
template <>
struct PixelTraits<double> {
    static constexpr Plx_PixelType code = PLX_TYPE_DOUBLE;
    static constexpr double scale = 1.0;
    static constexpr bool normalised = true;
    static constexpr bool integral = false;
    using Accum = double;
};

// Calls f(T{}) with T the C++ type of a numeric pixel type (uchar, ushort, int, uint, float,
// double); returns false without calling f for bit, pointer and unknown types.
template <class F>
bool dispatch_numeric_type(Plx_PixelType type, F &&f)
{
    switch (type) {
    case PLX_TYPE_UCHAR: f(uint8_t{}); return true;
    case PLX_TYPE_USHORT: f(uint16_t{}); return true;
    case PLX_TYPE_INT: f(int32_t{}); return true;
    case PLX_TYPE_UINT: f(uint32_t{}); return true;
    case PLX_TYPE_FLOAT: f(float{}); return true;
    case PLX_TYPE_DOUBLE: f(double{}); return true;
    default: return false;
    }
}

// Converts a value of pixel type S to pixel type D following the normalisation rules of
// image.h: rescale between normalised types, round to nearest and clamp into integer ranges.
template <class D, class S>
inline D convert_value(S s)
{
    double v = static_cast<double>(s);
    if constexpr (PixelTraits<S>::normalised && PixelTraits<D>::normalised &&
                  PixelTraits<S>::scale != PixelTraits<D>::scale)
        v = v * (PixelTraits<D>::scale / PixelTraits<S>::scale);
    if constexpr (PixelTraits<D>::integral) {
        constexpr double lo = static_cast<double>(std::numeric_limits<D>::lowest());
        constexpr double hi = static_cast<double>(std::numeric_limits<D>::max());
        if (!(v >= lo)) return static_cast<D>(std::numeric_limits<D>::lowest());  // NaN too
        if (v >= hi) return std::numeric_limits<D>::max();
        return static_cast<D>(v < 0 ? v - 0.5 : v + 0.5);
    } else {
        return static_cast<D>(v);
    }
}

}  // namespace plx

#endif
