// The match-move script reader on arbitrary files. The first byte picks the caller's side of
// the call (the size standing in for a missing dimensions line, and the name buffer); the rest
// is the file. Beyond the sanitizers' findings, a failed read must leave every output as it
// was, and a successful one must hand back a terminated name that fits its buffer.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <limits>

#include "fuzz_input_file.hpp"
#include "plano/matchmove.h"

namespace {

constexpr int32_t kMax = std::numeric_limits<int32_t>::max();
constexpr int32_t kMin = std::numeric_limits<int32_t>::min();

// Caller sizes (height, width): usable ones, the refused 0 and negatives, and the extremes
// that y is turned back against.
constexpr int32_t kSizes[][2] = {{480, 720}, {1, 1}, {0, 0}, {-1, 5},
                                 {kMax, kMax}, {kMin, kMin}, {7, 0}, {1080, 1920}};
// Name buffers: none, room for the empty name only, a short one, a usual one.
constexpr size_t kNameSizes[] = {0, 1, 8, 256};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    static const plano_fuzz::InputFile file("fuzz_matchmove");
    if (size == 0) return 0;
    const unsigned choice = data[0];
    const int32_t *caller = kSizes[choice % std::size(kSizes)];
    const size_t name_size = kNameSizes[(choice / std::size(kSizes)) % std::size(kNameSizes)];
    const std::string &path = file.write(data + 1, size - 1);

    int32_t height = caller[0], width = caller[1];
    char name[256 + 1];  // one byte past the largest buffer, to see that it stays untouched
    std::memset(name, 'k', sizeof name);
    Plx_List *keys = nullptr;
    const bool ok = bReadShakeMatchMoveFile(path.c_str(), &height, &width, name_size == 0 ? nullptr : name,
                                            name_size, &keys);
    if (!ok) {
        // Outputs are written only on success.
        if (keys != nullptr || height != caller[0] || width != caller[1] || name[0] != 'k') std::abort();
        return 0;
    }
    if (keys == nullptr || (name_size > 0 && std::memchr(name, '\0', name_size) == nullptr) ||
        name[name_size] != 'k')
        std::abort();
    plx_list_free(keys, free);
    return 0;
}
