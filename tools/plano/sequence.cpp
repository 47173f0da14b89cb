// Frame patterns and image files.
#include "sequence.hpp"

#include <OpenImageIO/imageio.h>
#include <fcntl.h>
#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <cctype>

#include "files.hpp"

namespace plano_tool {

namespace fs = std::filesystem;

FramePattern::FramePattern(const std::string &pattern) : pattern_(pattern)
{
    // printf-style fields: %d, %4d, %04d.
    struct Field {
        size_t begin, end;
        bool zero;
        int width;
    };
    std::vector<Field> fields;
    for (size_t i = pattern.find('%'); i != std::string::npos; i = pattern.find('%', i + 1)) {
        size_t k = i + 1;
        bool zero = k < pattern.size() && pattern[k] == '0';
        if (zero) ++k;
        size_t digits = k;
        while (k < pattern.size() && k - digits < 3 && std::isdigit(static_cast<unsigned char>(pattern[k]))) ++k;
        if (k >= pattern.size() || pattern[k] != 'd')
            throw ToolError("frame pattern '" + pattern + "' has a stray '%'");
        int width = k > digits ? std::stoi(pattern.substr(digits, k - digits)) : 0;
        fields.push_back({i, k + 1, zero, width});
        i = k;
    }
    size_t hashes = pattern.find('#');
    if (fields.size() == 1 && hashes == std::string::npos) {
        const Field &f = fields[0];
        prefix_ = pattern.substr(0, f.begin);
        suffix_ = pattern.substr(f.end);
        width_ = f.width;
        if (!f.zero && f.width > 0)
            throw ToolError("frame pattern '" + pattern + "': pad with zeros (%0" + std::to_string(f.width) + "d)");
    } else if (fields.empty() && hashes != std::string::npos) {
        size_t end = pattern.find_first_not_of('#', hashes);
        if (end == std::string::npos) end = pattern.size();
        if (pattern.find('#', end) != std::string::npos)
            throw ToolError("frame pattern '" + pattern + "' has more than one run of '#'");
        prefix_ = pattern.substr(0, hashes);
        suffix_ = pattern.substr(end);
        width_ = static_cast<int>(end - hashes);
    } else {
        throw ToolError("frame pattern '" + pattern +
                        "' needs exactly one frame number field (%04d or ####)");
    }
    if (width_ > 12) throw ToolError("frame pattern '" + pattern + "': frame field too wide");
}

std::string FramePattern::path(int frame) const
{
    char digits[32];
    std::snprintf(digits, sizeof digits, "%0*d", width_, frame);
    return prefix_ + digits + suffix_;
}

std::vector<int> FramePattern::frames_on_disk() const
{
    fs::path prefix_path(prefix_);
    fs::path dir = prefix_path.parent_path();
    std::string name_prefix = prefix_path.filename().string();
    if (prefix_.empty() || prefix_.back() == '/') name_prefix.clear();
    if (dir.empty()) dir = ".";
    std::vector<int> frames;
    std::error_code ec;
    for (fs::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec)) {
        std::string name = it->path().filename().string();
        if (name.size() <= name_prefix.size() + suffix_.size() || name.rfind(name_prefix, 0) != 0 ||
            name.compare(name.size() - suffix_.size(), suffix_.size(), suffix_) != 0)
            continue;
        std::string digits = name.substr(name_prefix.size(), name.size() - name_prefix.size() - suffix_.size());
        if (digits.empty() || digits.size() > 9 ||
            !std::all_of(digits.begin(), digits.end(), [](char c) { return c >= '0' && c <= '9'; }))
            continue;
        if (width_ > 0 && static_cast<int>(digits.size()) < width_) continue;
        int frame = std::stoi(digits);
        if (path(frame) == (dir / name).string() || path(frame) == name) frames.push_back(frame);
    }
    std::sort(frames.begin(), frames.end());
    return frames;
}

FrameRange parse_frame_range(const std::string &text)
{
    // FIRST-LAST, FIRST:LAST or one frame; frames may be negative.
    auto fail = [&]() -> FrameRange { throw ToolError("frame range '" + text + "' is not FIRST-LAST"); };
    size_t i = 0;
    auto number = [&](int &value) {
        while (i < text.size() && text[i] == ' ') ++i;
        size_t start = i;
        if (i < text.size() && text[i] == '-') ++i;
        size_t digits = i;
        while (i < text.size() && std::isdigit(static_cast<unsigned char>(text[i]))) ++i;
        if (i == digits || i - digits > 9) return false;
        value = std::stoi(text.substr(start, i - start));
        while (i < text.size() && text[i] == ' ') ++i;
        return true;
    };
    FrameRange r;
    if (!number(r.first)) return fail();
    r.last = r.first;
    if (i < text.size()) {
        if (text[i] != '-' && text[i] != ':') return fail();
        ++i;
        if (!number(r.last) || i != text.size()) return fail();
    }
    if (r.empty()) throw ToolError("frame range '" + text + "' ends before it starts");
    return r;
}

FrameRange resolve_frame_range(const FramePattern &pattern, const std::string &text)
{
    if (!text.empty()) return parse_frame_range(text);
    std::vector<int> frames = pattern.frames_on_disk();
    if (frames.empty()) throw ToolError("no files match the frame pattern '" + pattern.text() + "'");
    FrameRange r{frames.front(), frames.back()};
    if (static_cast<int>(frames.size()) != r.count())
        throw ToolError("frames of '" + pattern.text() + "' are not consecutive (" +
                        std::to_string(frames.size()) + " files between " + std::to_string(r.first) +
                        " and " + std::to_string(r.last) + "); give --frames");
    return r;
}

namespace {

Plx_ImageFormat format_of_channels(int channels)
{
    switch (channels) {
    case 1: return PLX_FORMAT_GREY;
    case 2: return PLX_FORMAT_GREY_ALPHA;
    case 3: return PLX_FORMAT_RGB;
    default: return PLX_FORMAT_RGBA;
    }
}

OIIO::TypeDesc oiio_type(Plx_PixelType type)
{
    switch (type) {
    case PLX_TYPE_UCHAR: return OIIO::TypeDesc::UINT8;
    case PLX_TYPE_USHORT: return OIIO::TypeDesc::UINT16;
    case PLX_TYPE_FLOAT: return OIIO::TypeDesc::FLOAT;
    default: return OIIO::TypeDesc::UNKNOWN;
    }
}

}  // namespace

namespace {

// Some image libraries print their own errors to stderr besides returning them; the tool's
// one-line message carries the reason, so their text is sent nowhere while a file is read.
class QuietStderr {
public:
    QuietStderr()
    {
        std::fflush(stderr);
        saved_ = ::dup(STDERR_FILENO);
        int null = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
        if (saved_ >= 0 && null >= 0) ::dup2(null, STDERR_FILENO);
        if (null >= 0) ::close(null);
    }
    ~QuietStderr()
    {
        std::fflush(stderr);
        if (saved_ >= 0) {
            ::dup2(saved_, STDERR_FILENO);
            ::close(saved_);
        }
    }
    QuietStderr(const QuietStderr &) = delete;
    QuietStderr &operator=(const QuietStderr &) = delete;

private:
    int saved_ = -1;
};

// OpenImageIO 2.4 leaks a message string when libpng jumps out of a damaged PNG. What the
// image library allocates while it reads is not ours to free, so under the leak checker it is
// not counted; our own allocations are made outside this scope.
#if defined(__SANITIZE_ADDRESS__)
class LibraryAllocations {
public:
    LibraryAllocations() { __lsan_disable(); }
    ~LibraryAllocations() { __lsan_enable(); }
    LibraryAllocations(const LibraryAllocations &) = delete;
    LibraryAllocations &operator=(const LibraryAllocations &) = delete;
};
#else
struct LibraryAllocations {
    LibraryAllocations() {}  // user-provided, so a scoped instance is not an unused variable
};
#endif

}  // namespace

ImagePtr read_image(const std::string &path)
{
    std::error_code ec;
    if (!fs::exists(path, ec)) throw ToolError("cannot read '" + path + "': no such file");
    auto fail = [&](const std::string &reason) -> void { throw ToolError("cannot read '" + path + "': " + reason); };
    QuietStderr quiet;
    auto in = OIIO::ImageInput::open(path);
    if (!in) {
        std::string reason = OIIO::geterror();
        fail(reason.empty() ? "unknown format" : reason);
    }
    const OIIO::ImageSpec &spec = in->spec();
    if (spec.width < 1 || spec.height < 1 || spec.nchannels < 1 || spec.depth > 1) fail("not a 2D image");
    if (int64_t{spec.width} * spec.height > kMaxImagePixels)
        fail(std::to_string(spec.width) + "x" + std::to_string(spec.height) + " is more than the " +
             std::to_string(kMaxImagePixels >> 20) + " million pixels an image may have");
    int channels = std::min(spec.nchannels, 4);
    Plx_PixelType type = spec.format == OIIO::TypeDesc::UINT8    ? PLX_TYPE_UCHAR
                         : spec.format == OIIO::TypeDesc::UINT16 ? PLX_TYPE_USHORT
                                                                 : PLX_TYPE_FLOAT;
    ImagePtr image = make_image(format_of_channels(channels), type, spec.height, spec.width);
    OIIO::stride_t pixel_bytes = static_cast<OIIO::stride_t>(channels * plx_image_type_size(type));
    bool read;
    {
        LibraryAllocations library;
        read = in->read_image(0, 0, 0, channels, oiio_type(type), image->data, pixel_bytes, image->stride);
    }
    // A reader may fill what it could not decode and still report success (a JPEG cut short
    // does): any error it recorded fails the read.
    std::string reason = in->geterror();
    if (!read || !reason.empty()) fail(reason.empty() ? "read failed" : reason);
    in->close();
    return image;
}

void write_image(const std::string &path, const Plx_Image &source)
{
    const Plx_Image *image = &source;
    ImagePtr converted;
    Plx_ImageFormat format = source.format;
    Plx_PixelType type = source.type;
    if (type != PLX_TYPE_UCHAR && type != PLX_TYPE_USHORT && type != PLX_TYPE_FLOAT)
        type = type == PLX_TYPE_BIT ? PLX_TYPE_UCHAR : PLX_TYPE_FLOAT;
    if (format == PLX_FORMAT_BGR) format = PLX_FORMAT_RGB;
    if (format == PLX_FORMAT_BGRA) format = PLX_FORMAT_RGBA;
    if (format != source.format || type != source.type) {
        converted = convert_image(source, format, type);
        image = converted.get();
    }
    write_atomically(path, [&](const std::string &temporary) {
        auto out = OIIO::ImageOutput::create(path);
        if (!out) throw ToolError("cannot write '" + path + "': " + OIIO::geterror());
        int channels = static_cast<int>(plx_image_format_channels(format));
        OIIO::ImageSpec spec(image->width, image->height, channels, oiio_type(type));
        if (channels == 2) spec.alpha_channel = 1;
        if (channels == 4) spec.alpha_channel = 3;
        // PNG frames are review and proxy output: zlib's fastest level writes them three times
        // faster than the default for files about 15 % larger (OpenCV writes at this level too).
        spec.attribute("png:compressionLevel", 1);
        OIIO::stride_t pixel_bytes = static_cast<OIIO::stride_t>(channels * plx_image_type_size(type));
        if (!out->open(temporary, spec) ||
            !out->write_image(oiio_type(type), image->data, pixel_bytes, image->stride) || !out->close())
            throw ToolError("cannot write '" + path + "': " + out->geterror());
    });
}

}  // namespace plano_tool
