// Shared pieces of the command-line tool: failures, image ownership, the reference host.
#ifndef PLANO_TOOL_TOOL_HPP
#define PLANO_TOOL_TOOL_HPP

#include <memory>
#include <stdexcept>
#include <string>

#include "plano/plano.h"
#include "plano_host/host.h"

namespace plano_tool {

// Text of several lines (a library's message) as one line: its lines trimmed and joined by
// "; ", cut to a length a terminal line holds.
std::string one_line(const std::string &text);

// A failure the user can act on; main prints "plano <command>: <message>" on one line.
class ToolError : public std::runtime_error {
public:
    explicit ToolError(const std::string &message, int exit_code = 1)
        : std::runtime_error(one_line(message)), exit_code_(exit_code)
    {
    }
    int exit_code() const { return exit_code_; }

private:
    int exit_code_;
};

// Exit codes: 1 bad input or a failed operation, 3 the region was lost, 130 interrupted.
constexpr int kExitFailure = 1;
constexpr int kExitLost = 3;
constexpr int kExitInterrupted = 130;

// The library's reason for the last failure, for a message ("function: message (code N)").
std::string library_reason();
// Throws ToolError("what: <library reason>") when ok is false.
void check(Plx_Bool ok, const std::string &what);

struct ImageDeleter {
    void operator()(Plx_Image *image) const noexcept { plx_image_free(image); }
};
using ImagePtr = std::unique_ptr<Plx_Image, ImageDeleter>;

// A new heap image; throws on failure.
ImagePtr make_image(Plx_ImageFormat format, Plx_PixelType type, int32_t height, int32_t width);
// The image converted to another format and type (a new image).
ImagePtr convert_image(const Plx_Image &image, Plx_ImageFormat format, Plx_PixelType type);

struct HostDeleter {
    void operator()(PlanoHost *host) const noexcept;
};
using HostPtr = std::unique_ptr<PlanoHost, HostDeleter>;

constexpr uint32_t kMaxThreads = 256;
// A reference host with `threads` jobs (0: one per hardware thread; at most kMaxThreads)
// whose interrupt flag is raised by Ctrl-C while it lives (see catch_interrupts).
HostPtr make_host(uint32_t threads);
// From now on Ctrl-C (and SIGTERM) raise the interrupt flag instead of ending the process.
void catch_interrupts();
// True once Ctrl-C was pressed.
bool interrupted();

}  // namespace plano_tool

#endif
