// Files in and out: outputs written atomically, inputs read within a size cap, and the checks
// that keep an output from landing on an input or on another output.
#ifndef PLANO_TOOL_FILES_HPP
#define PLANO_TOOL_FILES_HPP

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace plano_tool {

// What one input may cost. Larger inputs are refused before they are read.
constexpr int64_t kMaxImagePixels = int64_t{1} << 27;        // 134 million: 16384 x 8192
constexpr int64_t kMaxTextBytes = int64_t{256} << 20;        // track JSON, shape files
constexpr int64_t kMaxScriptBytes = int64_t{64} << 20;       // match-move scripts

// Writes path through write(temporary): the temporary is a new file in path's folder with
// the same extension; it replaces path only once write returned and its data reached the
// disk. On any failure path is left as it was and the temporary is removed. Folders along
// path are made. A path that exists and is not a regular file (a device, a pipe) is written
// in place.
void write_atomically(const std::string &path, const std::function<void(const std::string &temporary)> &write);
// The same for text.
void write_text_atomically(const std::string &path, const std::string &text);

// The whole of a regular file, refused above max_bytes.
std::string read_text_file(const std::string &path, int64_t max_bytes);
// Throws unless path is a regular file of at most max_bytes.
void check_input_file(const std::string &path, int64_t max_bytes);

// True when a and b name the same file (the same path, a link to it, or the same inode).
bool same_file(const std::string &a, const std::string &b);

// The paths a command reads and writes; check() refuses an output that is one of the inputs
// or the same file as another output, before anything is written.
class PathCheck {
public:
    void input(const std::string &path) { inputs_.push_back(path); }
    void output(const std::string &path, const std::string &option) { outputs_.push_back({path, option}); }
    void check() const;

private:
    struct Output {
        std::string path, option;
    };
    std::vector<std::string> inputs_;
    std::vector<Output> outputs_;
};

// "name.partial.ext" beside "name.ext": where a run that stopped early writes when a file is
// already at the path, so that a complete earlier result is never replaced by a partial one.
std::string partial_path(const std::string &path);

}  // namespace plano_tool

#endif
