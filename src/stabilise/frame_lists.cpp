// Anchor-frame lists typed by users: "3,5;7" over a frame range becomes one flag per frame.
#include <cstring>

#include "stabilise/stabilise_internal.hpp"

namespace {

// Longer runs of digits cannot be a frame number of any clip.
constexpr int kMaxDigits = 20;

bool is_digit(char c) { return c >= '0' && c <= '9'; }

// One pass over the text; with flags null it only validates, so a caller's array is written
// only once the whole list is known to be good. Starts the failure itself.
bool parse(uint32_t first, uint32_t last, const char *text, uint32_t *flags)
{
    const char *p = text;
    if (*p == '\0') return true;
    for (;;) {
        if (!is_digit(*p)) {
            PLX_ERR_START_AS("abParseStringOfFrames", PLX_ERROR_INCOMPATIBLE,
                             "a frame number must start here", p - text);
            return false;
        }
        // Twenty digits may exceed 64 bits; saturating keeps such a number out of range.
        uint64_t value = 0;
        bool saturated = false;
        int digits = 0;
        for (; is_digit(*p); ++p) {
            if (++digits > kMaxDigits) {
                PLX_ERR_START_AS("abParseStringOfFrames", PLX_ERROR_INCOMPATIBLE,
                                 "frame number longer than 20 digits", p - text);
                return false;
            }
            uint64_t digit = static_cast<uint64_t>(*p - '0');
            if (value > (UINT64_MAX - digit) / 10) saturated = true;
            if (!saturated) value = value * 10 + digit;
        }
        if (saturated || value < first || value > last) {
            PLX_ERR_START_AS("abParseStringOfFrames", PLX_ERROR_INCOMPATIBLE, "frame outside the range",
                             saturated ? -1 : static_cast<int64_t>(value));
            return false;
        }
        if (flags != nullptr) flags[value - first] = 1;
        if (*p == '\0') return true;
        if (*p != ',' && *p != ';') {
            PLX_ERR_START_AS("abParseStringOfFrames", PLX_ERROR_INCOMPATIBLE, "bad separator", p - text);
            return false;
        }
        ++p;
        if (*p == '\0') {
            PLX_ERR_START_AS("abParseStringOfFrames", PLX_ERROR_INCOMPATIBLE, "separator at the end", p - text);
            return false;
        }
    }
}

}  // namespace

extern "C" {

PLANO_API uint32_t *abParseStringOfFrames(uint32_t first, uint32_t last, const char *text, uint32_t *flags)
{
    if (first > last) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "first frame after last", first);
        return nullptr;
    }
    if (!plano::stabilise::given(__func__, text)) return nullptr;
    if (!parse(first, last, text, nullptr)) return nullptr;
    const std::size_t count = static_cast<std::size_t>(last - first) + 1;
    uint32_t *result = flags != nullptr ? flags : PLX_ALLOC(uint32_t, count);
    if (result == nullptr) return nullptr;
    std::memset(result, 0, count * sizeof(uint32_t));
    parse(first, last, text, result);
    return result;
}

}  // extern "C"
