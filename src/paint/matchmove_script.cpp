// Four-corner match-move scripts: the writer produces the compositor's node text, the reader
// takes back only the eight corner curves.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "common/internal.hpp"
#include "pellux/list.h"
#include "plano/matchmove.h"

namespace {

// Locale-independent "%f" (six decimals), so a host that changed LC_NUMERIC still writes a
// script the compositor reads.
void append_fixed(std::string &out, double value)
{
    char buffer[512];
    auto result = std::to_chars(buffer, buffer + sizeof buffer, value, std::chars_format::fixed, 6);
    out.append(buffer, result.ptr);
}

void append_int(std::string &out, int64_t value) { out += std::to_string(value); }

// One curve line of the script: every key's value at its frame.
template <class Value>
void append_curve(std::string &out, const Plx_List *keys, Value value, const char *end)
{
    out += "   Linear(0";
    for (const Plx_ListNode *node = keys->head; node != nullptr; node = node->next) {
        const auto *key = static_cast<const MatchMoveKey *>(node->data);
        out += ',';
        append_fixed(out, value(*key));
        out += '@';
        append_int(out, key->frame);
    }
    out += end;
}

// The node's fixed tail: four tracker boxes around the thirds of the frame.
const char kTrailer[] =
    "0, 0, Background.width, 0, 0, Background.height,\n"
    "Background.width, Background.height, \"default\", xFilter, 0, 0.5, 0, 1, \"Over\",\n"
    "0, \"v1.2\", 1, 20, \"1/16\", \"luminance\", 0.75, \"use start frame\",\n"
    "0.5, \"stop\", 0,\n"
    "\"track1\",\n"
    "Background.width/3-Background.height/30,\n"
    "    Background.width/3+Background.height/30,\n"
    "Background.height/3-Background.height/30,\n"
    "Background.height/3+Background.height/30,\n"
    "Background.width/3-Background.height/15,\n"
    "Background.width/3+Background.height/15,\n"
    "Background.height/3-Background.height/15,\n"
    "Background.height/3+Background.height/15,\n"
    "\"track2\",\n"
    "2*Background.width/3-Background.height/30,\n"
    "2*Background.width/3+Background.height/30,\n"
    "Background.height/3-Background.height/30,\n"
    "Background.height/3+Background.height/30,\n"
    "2*Background.width/3-Background.height/15,\n"
    "2*Background.width/3+Background.height/15,\n"
    "Background.height/3-Background.height/15,\n"
    "Background.height/3+Background.height/15,\n"
    "\"track3\",\n"
    "2*Background.width/3-Background.height/30,\n"
    "2*Background.width/3+Background.height/30,\n"
    "2*Background.height/3-Background.height/30,\n"
    "2*Background.height/3+Background.height/30,\n"
    "2*Background.width/3-Background.height/15,\n"
    "2*Background.width/3+Background.height/15,\n"
    "2*Background.height/3-Background.height/15,\n"
    "2*Background.height/3+Background.height/15,\n"
    "\"track4\",\n"
    "Background.width/3-Background.height/30,\n"
    "Background.width/3+Background.height/30,\n"
    "2*Background.height/3-Background.height/30,\n"
    "2*Background.height/3+Background.height/30,\n"
    "Background.width/3-Background.height/15,\n"
    "Background.width/3+Background.height/15,\n"
    "2*Background.height/3-Background.height/15,\n"
    "2*Background.height/3+Background.height/15);\n";

bool is_space(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f'; }

// A cursor over the script's text with the matching rules of formatted input: white space in
// a pattern matches any run of white space (none included), numbers may follow white space,
// every other pattern character must match exactly.
class Scanner {
public:
    explicit Scanner(const std::string &text)
        : begin_(text.data()), p_(text.data()), end_(text.data() + text.size())
    {
    }

    // Line number (from 1) of the cursor, for the failure record.
    int64_t line() const { return 1 + std::count(begin_, p_, '\n'); }

    void skip_space()
    {
        while (p_ < end_ && is_space(*p_)) ++p_;
    }
    int peek() const { return p_ < end_ ? static_cast<unsigned char>(*p_) : EOF; }
    bool literal(const char *pattern)
    {
        for (; *pattern != '\0'; ++pattern) {
            if (is_space(*pattern)) {
                skip_space();
            } else {
                if (p_ >= end_ || *p_ != *pattern) return false;
                ++p_;
            }
        }
        return true;
    }
    bool integer(int64_t &value, bool allow_sign)
    {
        skip_space();
        const char *start = p_;
        if (p_ < end_ && *p_ == '+') ++p_;
        else if (allow_sign && p_ < end_ && *p_ == '-') ++p_;
        const char *digits = p_;
        while (p_ < end_ && *p_ >= '0' && *p_ <= '9') ++p_;
        if (p_ == digits || p_ - digits > 18) {
            p_ = start;
            return false;
        }
        value = 0;
        for (const char *d = digits; d < p_; ++d) value = value * 10 + (*d - '0');
        if (*start == '-') value = -value;
        return true;
    }
    bool int32(int32_t &value)
    {
        int64_t v;
        if (!integer(v, true) || v < std::numeric_limits<int32_t>::min() ||
            v > std::numeric_limits<int32_t>::max())
            return false;
        value = static_cast<int32_t>(v);
        return true;
    }
    bool uint32(uint32_t &value)
    {
        int64_t v;
        if (!integer(v, false) || v > std::numeric_limits<uint32_t>::max()) return false;
        value = static_cast<uint32_t>(v);
        return true;
    }
    bool real(double &value)
    {
        skip_space();
        const char *start = p_;
        if (start < end_ && *start == '+') ++start;
        auto result = std::from_chars(start, end_, value);
        if (result.ec != std::errc()) return false;
        p_ = result.ptr;
        return true;
    }
    // A run of non-space characters, after white space.
    bool word(std::string &value)
    {
        skip_space();
        const char *start = p_;
        while (p_ < end_ && !is_space(*p_)) ++p_;
        value.assign(start, p_);
        return p_ > start;
    }
    void skip_line()
    {
        while (p_ < end_ && *p_ != '\n') ++p_;
        if (p_ < end_) ++p_;
    }

private:
    const char *begin_;
    const char *p_;
    const char *end_;
};

enum class ReadResult { kOk, kMalformed, kNoDimensions, kNameTooLong, kNoMemory };

struct ParsedScript {
    int32_t height = 0, width = 0;
    std::string name;
    std::vector<MatchMoveKey> keys;
};

// Where in the key the curve's value goes: curves run x1, y1, x2, y2, x3, y3, x4, y4.
double &curve_value(MatchMoveKey &key, int curve) { return key.corners[curve / 2][curve % 2]; }

// Parses the whole script into plain storage; nothing of the caller's is touched here.
ReadResult parse_body(Scanner &in, int32_t height, int32_t width, ParsedScript &out)
{
    int32_t first_file = 0, last_file = 0;
    if (!in.literal("# This corresponds to file numbers") || !in.int32(first_file) ||
        !in.literal("-") || !in.int32(last_file) || !in.literal(" in the original clip\n"))
        return ReadResult::kMalformed;
    if (first_file < 0 || first_file > last_file) return ReadResult::kMalformed;

    if (in.peek() == '#') {
        if (!in.literal("# Image dimensions") || !in.int32(width) || !in.literal("x") ||
            !in.int32(height) || !in.literal("\n"))
            return ReadResult::kMalformed;
    } else if (width < 1 || height < 1) {
        return ReadResult::kNoDimensions;
    }

    int32_t ignored = 0;
    if (!in.word(out.name) || !in.literal(" = MatchMove(0, 0,") || !in.int32(ignored) ||
        !in.literal(", \"4 point\",\n"))
        return ReadResult::kMalformed;

    // Corner 1's x curve decides the keys and the renumbering offset.
    if (!in.literal(" Linear(0")) return ReadResult::kMalformed;
    int64_t offset = 0;
    for (;;) {
        int c = in.peek();
        if (c == ')') break;
        if (c != ',') return ReadResult::kMalformed;
        in.literal(",");
        MatchMoveKey key{};
        uint32_t frame = 0;
        if (!in.real(key.corners[0][0]) || !in.literal("@") || !in.uint32(frame))
            return ReadResult::kMalformed;
        if (out.keys.empty()) offset = int64_t{first_file} - frame;
        int64_t renumbered = int64_t{frame} + offset;
        if (renumbered < 0 || renumbered > std::numeric_limits<uint32_t>::max())
            return ReadResult::kMalformed;
        key.frame = static_cast<uint32_t>(renumbered);
        out.keys.push_back(key);
    }
    in.skip_line();

    for (int curve = 1; curve < 8; ++curve) {
        if (!in.literal(" Linear(0")) return ReadResult::kMalformed;
        for (MatchMoveKey &key : out.keys) {
            uint32_t frame = 0;
            if (!in.literal(",") || !in.real(curve_value(key, curve)) || !in.literal("@") ||
                !in.uint32(frame) || int64_t{frame} + offset != int64_t{key.frame})
                return ReadResult::kMalformed;
        }
        if (curve == 1 || curve == 3) {
            int32_t a = 0, b = 0;
            if (!in.literal("),") || !in.int32(a) || !in.literal(",") || !in.int32(b) ||
                !in.literal(",\n") || a != 1 || b != 1)
                return ReadResult::kMalformed;
        } else if (!in.literal("),\n")) {
            return ReadResult::kMalformed;
        }
    }

    for (MatchMoveKey &key : out.keys)
        for (auto &corner : key.corners) corner[1] = height - corner[1];
    out.height = height;
    out.width = width;
    return ReadResult::kOk;
}

ReadResult parse_script(const std::string &text, int32_t height, int32_t width, ParsedScript &out,
                        int64_t &failed_line)
{
    Scanner in(text);
    ReadResult result = parse_body(in, height, width, out);
    if (result == ReadResult::kMalformed) failed_line = in.line();
    return result;
}

// Far more than any shot's keys take (a frame costs under 200 bytes); past it the input is
// taken for an endless device or pipe.
constexpr size_t kMostScriptBytes = size_t{1} << 30;

// Reads the whole file, except that one whose first byte cannot start a script is not read
// on (a large binary file or a device of zeros fails at once). False when it cannot be read
// or is larger than any script.
bool read_file(FILE *file, std::string &text)
{
    char buffer[65536];
    size_t n;
    while ((n = std::fread(buffer, 1, sizeof buffer, file)) > 0) {
        text.append(buffer, n);
        if (text[0] != '#') break;
        if (text.size() > kMostScriptBytes) return false;
    }
    return !std::ferror(file);
}

struct FileCloser {
    void operator()(FILE *f) const noexcept { std::fclose(f); }
};

void free_key(void *key) { std::free(key); }

// A new file in the folder of path, named after it; null (errno set) when none can be made
// there, for example in a folder the caller may not write.
FILE *open_beside(const char *path, std::string &made)
{
    static std::atomic<unsigned> count{0};
    std::string name(path);
    size_t slash = name.rfind('/');
    std::string folder = slash == std::string::npos ? std::string() : name.substr(0, slash + 1);
    std::string base = slash == std::string::npos ? name : name.substr(slash + 1);
    for (int attempt = 0; attempt < 16; ++attempt) {
        std::string candidate = folder + "." + base + ".tmp" + std::to_string(::getpid()) + "-" +
                                std::to_string(count++);
        int fd = ::open(candidate.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
        if (fd < 0) {
            if (errno == EEXIST) continue;
            return nullptr;
        }
        FILE *file = ::fdopen(fd, "w");
        if (file == nullptr) {
            ::close(fd);
            ::unlink(candidate.c_str());
            return nullptr;
        }
        made = candidate;
        return file;
    }
    return nullptr;
}

}  // namespace

extern "C" {

PLANO_API Plx_Bool bWriteShakeMatchMoveFile(const char *path, int32_t height, int32_t width,
                                            const char *node_name, const Plx_List *keys,
                                            double scale)
{
    if (path == nullptr || node_name == nullptr || keys == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    if (height < 1 || width < 1 || !std::isfinite(scale) || !(scale > 0.0) ||
        !std::isfinite(height * scale) || height * scale >= 2147483648.0 ||
        width * scale >= 2147483648.0) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "image size or scale", 0);
        return PLX_FALSE;
    }
    size_t name_length = std::strlen(node_name);
    bool name_ok = name_length > 0;
    for (size_t i = 0; i < name_length && name_ok; ++i) name_ok = !is_space(node_name[i]);
    if (!name_ok) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "node name must be one word", 0);
        return PLX_FALSE;
    }
    if (keys->head == nullptr) {
        PLX_ERR_START(PLX_ERROR_NOT_ENOUGH_DATA, "no keys", 0);
        return PLX_FALSE;
    }
    int64_t previous = -1;
    for (const Plx_ListNode *node = keys->head; node != nullptr; node = node->next) {
        const auto *key = static_cast<const MatchMoveKey *>(node->data);
        if (key == nullptr || key->frame > static_cast<uint32_t>(std::numeric_limits<int32_t>::max())) {
            PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null key or frame number too large", 0);
            return PLX_FALSE;
        }
        for (const auto &corner : key->corners) {
            if (!std::isfinite(corner[0] * scale) || !std::isfinite((height - corner[1]) * scale)) {
                PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "corner not finite", key->frame);
                return PLX_FALSE;
            }
        }
        if (int64_t{key->frame} <= previous) {
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "frames not in ascending order", key->frame);
            return PLX_FALSE;
        }
        previous = key->frame;
    }

    std::string text;
    try {
        const auto *first = static_cast<const MatchMoveKey *>(keys->head->data);
        const auto *last = static_cast<const MatchMoveKey *>(keys->tail->data);
        text = "# This corresponds to file numbers " + std::to_string(first->frame) + "-" +
               std::to_string(last->frame) + " in the original clip\n";
        text += "# Image dimensions " + std::to_string(static_cast<int32_t>(width * scale)) + "x" +
                std::to_string(static_cast<int32_t>(height * scale)) + "\n";
        text += node_name;
        text += " = MatchMove(0, 0, 1, \"4 point\",\n";
        for (int corner = 0; corner < 4; ++corner) {
            append_curve(text, keys, [&](const MatchMoveKey &k) { return k.corners[corner][0] * scale; },
                         "),\n");
            append_curve(text, keys,
                         [&](const MatchMoveKey &k) { return (height - k.corners[corner][1]) * scale; },
                         corner < 2 ? "), 1, 1,\n" : "),\n");
        }
        text += kTrailer;
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "script text", 0);
        return PLX_FALSE;
    }

    // A regular file is replaced whole: the script goes to a new file beside it, renamed over
    // it once complete, so a failed write leaves the earlier script as it was. A device or a
    // pipe is written in place, and nothing this call did not make is ever removed.
    struct stat target;
    const bool exists = ::stat(path, &target) == 0;
    std::string temporary;
    FILE *file = nullptr;
    if (!exists || S_ISREG(target.st_mode)) {
        file = open_beside(path, temporary);
        if (file != nullptr && exists) ::fchmod(::fileno(file), target.st_mode & 07777);
    }
    if (file == nullptr) file = std::fopen(path, "w");
    if (file == nullptr) {
        // Registered under the name callers of the compositor bridge have always searched for.
        PLX_ERR_START_AS("pWriteShakeMatchMoveFile", PLX_ERROR_OPENING_FILE, path, errno);
        return PLX_FALSE;
    }
    bool written = std::fwrite(text.data(), 1, text.size(), file) == text.size();
    written = std::fflush(file) == 0 && written;
    if (!temporary.empty()) written = ::fsync(::fileno(file)) == 0 && written;
    written = (std::fclose(file) == 0) && written;
    if (written && !temporary.empty()) written = std::rename(temporary.c_str(), path) == 0;
    if (!written) {
        if (!temporary.empty()) std::remove(temporary.c_str());
        else if (!exists) std::remove(path);
        PLX_ERR_START(PLX_ERROR_WRITING_FILE, path, 0);
        return PLX_FALSE;
    }
    return PLX_TRUE;
}

PLANO_API Plx_Bool bReadShakeMatchMoveFile(const char *path, int32_t *height, int32_t *width,
                                           char *node_name, size_t node_name_size,
                                           Plx_List **keys)
{
    if (path == nullptr || height == nullptr || width == nullptr || keys == nullptr) {
        PLX_ERR_START(PLX_ERROR_ILLEGAL_ARGUMENT, "null argument", 0);
        return PLX_FALSE;
    }
    ParsedScript script;
    try {
        std::unique_ptr<FILE, FileCloser> file(std::fopen(path, "r"));
        if (!file) {
            PLX_ERR_START(PLX_ERROR_OPENING_FILE, path, errno);
            return PLX_FALSE;
        }
        std::string text;
        if (!read_file(file.get(), text)) {
            PLX_ERR_START(PLX_ERROR_CORRUPTED_FILE, "read error or larger than any script; number: bytes read",
                          static_cast<int64_t>(text.size()));
            return PLX_FALSE;
        }
        file.reset();
        int64_t line = 0;
        switch (parse_script(text, *height, *width, script, line)) {
        case ReadResult::kOk:
            break;
        case ReadResult::kNoDimensions:
            PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "no dimensions line and no positive size given", 0);
            return PLX_FALSE;
        default:
            PLX_ERR_START(PLX_ERROR_CORRUPTED_FILE, "malformed script; number: line", line);
            return PLX_FALSE;
        }
    } catch (const std::bad_alloc &) {
        PLX_ERR_START(PLX_ERROR_MALLOC_FAILED, "script", 0);
        return PLX_FALSE;
    }
    if (node_name != nullptr && script.name.size() >= node_name_size) {
        PLX_ERR_START(PLX_ERROR_INCOMPATIBLE, "node name longer than its buffer",
                      static_cast<int64_t>(script.name.size()));
        return PLX_FALSE;
    }

    Plx_List *list = plx_list_new();
    if (list == nullptr) {
        PLX_ERR_PASS();
        return PLX_FALSE;
    }
    for (const MatchMoveKey &parsed : script.keys) {
        MatchMoveKey *key = PLX_ALLOC(MatchMoveKey, 1);
        if (key == nullptr) {
            plx_list_free(list, free_key);
            return PLX_FALSE;
        }
        *key = parsed;
        if (!plx_list_insert_last(list, key)) {
            std::free(key);
            plx_list_free(list, free_key);
            PLX_ERR_PASS();
            return PLX_FALSE;
        }
    }
    if (node_name != nullptr) std::memcpy(node_name, script.name.c_str(), script.name.size() + 1);
    *height = script.height;
    *width = script.width;
    *keys = list;
    return PLX_TRUE;
}

}  // extern "C"
