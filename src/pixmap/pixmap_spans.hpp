// Bit rows: reading one bit, and writing runs of bits a whole word at a time.
#ifndef PLANO_SRC_PIXMAP_PIXMAP_SPANS_HPP
#define PLANO_SRC_PIXMAP_PIXMAP_SPANS_HPP

#include <cstdint>

namespace plano::pixmap {

inline bool bit_at(const uint32_t *row, int32_t c) { return ((row[c >> 5] >> (c & 31)) & 1u) != 0; }

enum class BitOp { set, clear, invert };

inline void apply_word(uint32_t &word, uint32_t mask, BitOp op)
{
    switch (op) {
    case BitOp::set: word |= mask; break;
    case BitOp::clear: word &= ~mask; break;
    case BitOp::invert: word ^= mask; break;
    }
}

// Applies op to bits first..last (inclusive) of a bit row.
inline void apply_bits(uint32_t *row, int32_t first, int32_t last, BitOp op)
{
    const int32_t w0 = first >> 5, w1 = last >> 5;
    const uint32_t head = ~0u << (first & 31), tail = ~0u >> (31 - (last & 31));
    if (w0 == w1) {
        apply_word(row[w0], head & tail, op);
        return;
    }
    apply_word(row[w0], head, op);
    for (int32_t w = w0 + 1; w < w1; ++w) apply_word(row[w], ~0u, op);
    apply_word(row[w1], tail, op);
}

}  // namespace plano::pixmap

#endif
