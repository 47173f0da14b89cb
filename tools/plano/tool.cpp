// Failures, images and the host with its Ctrl-C hook.
#include "tool.hpp"

#include <atomic>
#include <csignal>

namespace plano_tool {

std::string one_line(const std::string &text)
{
    constexpr size_t kMostCharacters = 400;
    std::string out;
    size_t begin = 0;
    while (begin <= text.size()) {
        size_t end = text.find_first_of("\r\n", begin);
        if (end == std::string::npos) end = text.size();
        size_t first = text.find_first_not_of(" \t", begin);
        size_t last = text.find_last_not_of(" \t", end == 0 ? 0 : end - 1);
        if (first != std::string::npos && first < end && last != std::string::npos && last >= first) {
            if (!out.empty()) out += "; ";
            out.append(text, first, last - first + 1);
        }
        begin = end + 1;
    }
    for (char &c : out)
        if (c == '\t' || static_cast<unsigned char>(c) < 0x20) c = ' ';
    if (out.size() > kMostCharacters) out = out.substr(0, kMostCharacters - 3) + "...";
    return out;
}

std::string library_reason()
{
    char buffer[512];
    if (plx_err_describe_origin(buffer, sizeof buffer) == 0) return "unknown reason";
    return buffer;
}

void check(Plx_Bool ok, const std::string &what)
{
    if (!ok) throw ToolError(what + ": " + library_reason());
}

ImagePtr make_image(Plx_ImageFormat format, Plx_PixelType type, int32_t height, int32_t width)
{
    ImagePtr image(plx_image_form_gen(nullptr, format, type, height, width));
    if (!image) throw ToolError("cannot make a " + std::to_string(width) + "x" + std::to_string(height) +
                                " image: " + library_reason());
    return image;
}

ImagePtr convert_image(const Plx_Image &image, Plx_ImageFormat format, Plx_PixelType type)
{
    ImagePtr out(plx_image_convert_q(&image, format, type, nullptr));
    if (!out) throw ToolError("cannot convert an image: " + library_reason());
    return out;
}

namespace {

// The host Ctrl-C stops. Its interrupt flag is a lock-free atomic, so raising it from the
// signal handler is safe; the engine polls it between bands of work.
std::atomic<PlanoHost *> g_host{nullptr};
volatile std::sig_atomic_t g_interrupted = 0;

extern "C" void on_interrupt(int)
{
    g_interrupted = 1;
    if (PlanoHost *host = g_host.load()) plano_host_request_interrupt(host, 1);
}

}  // namespace

bool interrupted() { return g_interrupted != 0; }

void catch_interrupts()
{
    struct sigaction action = {};
    action.sa_handler = on_interrupt;
    sigemptyset(&action.sa_mask);
    sigaction(SIGINT, &action, nullptr);
    sigaction(SIGTERM, &action, nullptr);
}

void HostDeleter::operator()(PlanoHost *host) const noexcept
{
    PlanoHost *expected = host;
    g_host.compare_exchange_strong(expected, nullptr);
    plano_host_free(host);
}

HostPtr make_host(uint32_t threads)
{
    if (threads > kMaxThreads) throw ToolError("threads must be 0 (one per core) to " + std::to_string(kMaxThreads));
    HostPtr host(plano_host_new(threads));
    if (!host) throw ToolError("cannot make the thread host (out of memory)");
    g_host.store(host.get());
    if (g_interrupted) plano_host_request_interrupt(host.get(), 1);
    return host;
}

}  // namespace plano_tool
