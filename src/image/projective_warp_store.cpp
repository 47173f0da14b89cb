// The warp's last stages: sampled pixels converted from the source's format into the
// output's (through the working format, where colour correction acts), then written in the
// output's pixel type.
#include "image/projective_warp_internal.hpp"
#include "image/projective_warp_bilinear_simd.hpp"

namespace plano::warp {

namespace {

template <Plx_ImageFormat S, Plx_ImageFormat O>
void convert_row(const Correction &cc, int32_t n, const uint8_t *status, const float *pixels, const float *coverage,
                 float *converted)
{
    constexpr Plx_ImageFormat W = working_format(S, O);
    constexpr int cs = format_info(S).channels, co = format_info(O).channels;
    const bool correct = cc.mode >= 0;
    for (int32_t i = 0; i < n; ++i) {
        if (status[i] != kWrite && status[i] != kWriteInvalid) continue;
        float work[4];
        // Without an alpha channel of its own, a high-quality sample's alpha is its coverage.
        const float alpha = coverage != nullptr ? coverage[i] : 1.0f;
        convert_pixel<S, W>(pixels + std::ptrdiff_t(i) * cs, alpha, work);
        if (correct) correct_pixel<W>(cc, work);
        convert_pixel<W, O>(work, 1.0f, converted + std::ptrdiff_t(i) * co);
    }
}

template <Plx_ImageFormat S>
ConvertRowFn converter_from(Plx_ImageFormat o)
{
    switch (o) {
    case PLX_FORMAT_GREY: return convert_row<S, PLX_FORMAT_GREY>;
    case PLX_FORMAT_GREY_ALPHA: return convert_row<S, PLX_FORMAT_GREY_ALPHA>;
    case PLX_FORMAT_RGB: return convert_row<S, PLX_FORMAT_RGB>;
    case PLX_FORMAT_RGBA: return convert_row<S, PLX_FORMAT_RGBA>;
    case PLX_FORMAT_BGR: return convert_row<S, PLX_FORMAT_BGR>;
    case PLX_FORMAT_BGRA: return convert_row<S, PLX_FORMAT_BGRA>;
    default: return nullptr;
    }
}

template <class T, int C>
void store_row(Plx_Image *output, int32_t row, int32_t col, int32_t n, const uint8_t *status, const float *pixels)
{
    T *out = static_cast<T *>(plx_image_row(output, row)) + std::ptrdiff_t(col) * C;
    int32_t all = 0;
    while (all < n && status[all] == kWrite) ++all;
    if (all == n) {
        // Every pixel written: one plain loop the compiler can vectorise.
        if constexpr (std::is_same_v<T, uint8_t>)
            store_u8_run(pixels, out, std::size_t(n) * C);
        else
            for (int32_t k = 0; k < n * C; ++k) out[k] = store_value<T>(pixels[k]);
        return;
    }
    for (int32_t i = 0; i < n; ++i) {
        if (status[i] != kWrite && status[i] != kWriteInvalid) continue;
        for (int c = 0; c < C; ++c) out[std::ptrdiff_t(i) * C + c] = store_value<T>(pixels[std::ptrdiff_t(i) * C + c]);
    }
}

void store_bits(Plx_Image *output, int32_t row, int32_t col, int32_t n, const uint8_t *status, const float *pixels)
{
    auto *words = static_cast<uint32_t *>(plx_image_row(output, row));
    for (int32_t i = 0; i < n; ++i) {
        if (status[i] != kWrite && status[i] != kWriteInvalid) continue;
        const int32_t c = col + i;
        const uint32_t bit = 1u << (c & 31);
        if (pixels[i] >= 0.5f)
            words[c >> 5] |= bit;
        else
            words[c >> 5] &= ~bit;
    }
}

}  // namespace

ConvertRowFn converter(Plx_ImageFormat source, Plx_ImageFormat output)
{
    switch (source) {
    case PLX_FORMAT_GREY: return converter_from<PLX_FORMAT_GREY>(output);
    case PLX_FORMAT_GREY_ALPHA: return converter_from<PLX_FORMAT_GREY_ALPHA>(output);
    case PLX_FORMAT_RGB: return converter_from<PLX_FORMAT_RGB>(output);
    case PLX_FORMAT_RGBA: return converter_from<PLX_FORMAT_RGBA>(output);
    case PLX_FORMAT_BGR: return converter_from<PLX_FORMAT_BGR>(output);
    case PLX_FORMAT_BGRA: return converter_from<PLX_FORMAT_BGRA>(output);
    default: return nullptr;
    }
}

StoreRowFn storer(const Plx_Image *output)
{
    if (output->type == PLX_TYPE_BIT) return output->format == PLX_FORMAT_GREY ? store_bits : nullptr;
    StoreRowFn fn = nullptr;
    const int channels = int(plx_image_format_channels(output->format));
    plx::dispatch_numeric_type(output->type, [&](auto tag) {
        using T = decltype(tag);
        switch (channels) {
        case 1: fn = store_row<T, 1>; break;
        case 2: fn = store_row<T, 2>; break;
        case 3: fn = store_row<T, 3>; break;
        case 4: fn = store_row<T, 4>; break;
        default: break;
        }
    });
    return fn;
}

}  // namespace plano::warp
