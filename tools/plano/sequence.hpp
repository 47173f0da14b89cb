// Image sequences: frame patterns and reading and writing frames through OpenImageIO.
#ifndef PLANO_TOOL_SEQUENCE_HPP
#define PLANO_TOOL_SEQUENCE_HPP

#include <string>
#include <vector>

#include "tool.hpp"

namespace plano_tool {

// A frame pattern: a printf-style field (%d, %04d) or a run of '#' (one per digit) stands for
// the frame number. A path without a field is refused.
class FramePattern {
public:
    explicit FramePattern(const std::string &pattern);
    std::string path(int frame) const;
    const std::string &text() const { return pattern_; }
    // The frames present on disk, ascending.
    std::vector<int> frames_on_disk() const;

private:
    std::string pattern_, prefix_, suffix_;
    int width_ = 0;
};

// "10-20", "10:20" or "15" (one frame).
struct FrameRange {
    int first = 0, last = -1;
    bool empty() const { return last < first; }
    int count() const { return last - first + 1; }
};
FrameRange parse_frame_range(const std::string &text);
// The given range, or every frame of the pattern on disk when text is empty (they must be
// consecutive).
FrameRange resolve_frame_range(const FramePattern &pattern, const std::string &text);

// Reads an image: 8-bit files as unsigned char, 16-bit as unsigned short, everything else as
// float; 1 to 4 channels as grey, grey-alpha, RGB, RGBA (further channels are dropped).
ImagePtr read_image(const std::string &path);
// Writes an image in its own type (bit images as 8-bit grey); the file's format follows the
// extension. Written atomically: see write_atomically.
void write_image(const std::string &path, const Plx_Image &image);

}  // namespace plano_tool

#endif
