// Atomic outputs, bounded inputs and the output-versus-input checks.
#include "files.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>

#include "tool.hpp"

namespace plano_tool {

namespace fs = std::filesystem;

namespace {

std::string megabytes(int64_t bytes) { return std::to_string(bytes >> 20) + " MB"; }

// Flushes a written file to the disk; a failure here (a full disk on a delayed write) is a
// failure of the write.
void sync_file(const std::string &path, const std::string &shown)
{
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) throw ToolError("cannot write '" + shown + "': " + std::strerror(errno));
    int failed = ::fsync(fd) != 0 ? errno : 0;
    ::close(fd);
    if (failed != 0 && failed != EINVAL) throw ToolError("cannot write '" + shown + "': " + std::strerror(failed));
}

// Makes the rename itself durable; a folder that cannot be synced is no reason to fail.
void sync_folder(const fs::path &folder)
{
    int fd = ::open(folder.empty() ? "." : folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return;
    ::fsync(fd);
    ::close(fd);
}

std::atomic<unsigned> g_temporary_count{0};

}  // namespace

void write_atomically(const std::string &path, const std::function<void(const std::string &temporary)> &write)
{
    fs::path target(path);
    std::error_code ec;
    fs::file_status status = fs::status(target, ec);
    if (fs::exists(status)) {
        if (fs::is_directory(status)) throw ToolError("cannot write '" + path + "': it is a folder");
        // A device or a pipe cannot be replaced by renaming, and must not be.
        if (!fs::is_regular_file(status)) {
            write(path);
            return;
        }
        // Through a link, the file it points to is replaced and the link kept.
        if (fs::is_symlink(fs::symlink_status(target, ec))) target = fs::canonical(target, ec);
    }
    fs::path folder = target.parent_path();
    if (!folder.empty() && !fs::is_directory(folder, ec)) {
        fs::create_directories(folder, ec);
        if (ec) throw ToolError("cannot write '" + path + "': cannot make folder '" + folder.string() + "': " + ec.message());
    }
    // Hidden, unique to this process and call, and ending in the target's extension, which
    // image writers go by.
    fs::path temporary = folder / (".plano-" + std::to_string(::getpid()) + "-" +
                                   std::to_string(g_temporary_count++) + "-" + target.filename().string());
    struct Remover {
        fs::path path;
        bool armed = true;
        ~Remover()
        {
            std::error_code ignored;
            if (armed) fs::remove(path, ignored);
        }
    } remover{temporary};
    write(temporary.string());
    sync_file(temporary.string(), path);
    struct stat old;
    if (::stat(target.c_str(), &old) == 0) ::chmod(temporary.c_str(), old.st_mode & 07777);
    if (::rename(temporary.c_str(), target.c_str()) != 0)
        throw ToolError("cannot write '" + path + "': " + std::strerror(errno));
    remover.armed = false;
    sync_folder(folder);
}

void write_text_atomically(const std::string &path, const std::string &text)
{
    write_atomically(path, [&](const std::string &temporary) {
        int fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
        if (fd < 0) throw ToolError("cannot write '" + path + "': " + std::strerror(errno));
        const char *p = text.data();
        size_t left = text.size();
        while (left > 0) {
            ssize_t n = ::write(fd, p, left);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) {
                int failed = n < 0 ? errno : ENOSPC;
                ::close(fd);
                throw ToolError("cannot write '" + path + "': " + std::strerror(failed));
            }
            p += n;
            left -= static_cast<size_t>(n);
        }
        if (::close(fd) != 0) throw ToolError("cannot write '" + path + "': " + std::strerror(errno));
    });
}

void check_input_file(const std::string &path, int64_t max_bytes)
{
    std::error_code ec;
    fs::file_status status = fs::status(path, ec);
    if (!fs::exists(status)) throw ToolError("cannot read '" + path + "': no such file");
    if (!fs::is_regular_file(status)) throw ToolError("cannot read '" + path + "': not a regular file");
    auto size = fs::file_size(path, ec);
    if (!ec && static_cast<int64_t>(size) > max_bytes)
        throw ToolError("cannot read '" + path + "': larger than " + megabytes(max_bytes) + ", the most it may be");
}

std::string read_text_file(const std::string &path, int64_t max_bytes)
{
    check_input_file(path, max_bytes);
    std::ifstream in(path, std::ios::binary);
    if (!in) throw ToolError("cannot read '" + path + "': " + std::strerror(errno));
    std::string text;
    char buffer[1 << 16];
    // The size is checked again while reading: the file may grow under us.
    while (in.read(buffer, sizeof buffer) || in.gcount() > 0) {
        text.append(buffer, static_cast<size_t>(in.gcount()));
        if (static_cast<int64_t>(text.size()) > max_bytes)
            throw ToolError("cannot read '" + path + "': larger than " + megabytes(max_bytes) + ", the most it may be");
    }
    if (in.bad()) throw ToolError("cannot read '" + path + "': read error");
    return text;
}

namespace {

// One key per file: its device and inode when it exists, else its resolved absolute path.
std::string file_key(const std::string &path)
{
    std::string key;
    struct stat st;
    if (::stat(path.c_str(), &st) == 0) {
        key = std::to_string(st.st_dev);
        key += ':';
        key += std::to_string(st.st_ino);
        return key;
    }
    std::error_code ec;
    fs::path absolute = fs::absolute(path, ec);
    fs::path resolved = fs::weakly_canonical(absolute, ec);
    // Paths are absolute, so they never look like a device and inode pair.
    key = (ec ? absolute.lexically_normal() : resolved).string();
    return key;
}

}  // namespace

bool same_file(const std::string &a, const std::string &b) { return a == b || file_key(a) == file_key(b); }

void PathCheck::check() const
{
    std::map<std::string, const std::string *> inputs;
    for (const std::string &path : inputs_) inputs.emplace(file_key(path), &path);
    std::map<std::string, const Output *> outputs;
    for (const Output &out : outputs_) {
        std::string key = file_key(out.path);
        if (auto in = inputs.find(key); in != inputs.end())
            throw ToolError(out.option + " '" + out.path + "' would overwrite the input '" + *in->second + "'");
        auto [other, fresh] = outputs.emplace(key, &out);
        if (!fresh)
            throw ToolError(other->second->option + " and " + out.option + " both write '" + out.path + "'");
    }
}

std::string partial_path(const std::string &path)
{
    fs::path p(path);
    return (p.parent_path() / (p.stem().string() + ".partial" + p.extension().string())).string();
}

}  // namespace plano_tool
