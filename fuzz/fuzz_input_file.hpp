// The readers under test take a path, so each input goes through one file per process,
// rewritten for every run. The file is an anonymous one in memory, named through /proc: no
// directory is made, a run costs no disk work (truncating a file on disk costs milliseconds,
// a hundred times the reading under test), and nothing is left behind however the process
// ends (a crash, or libFuzzer's merge child, which exits without running destructors).
#ifndef PLANO_FUZZ_INPUT_FILE_HPP
#define PLANO_FUZZ_INPUT_FILE_HPP

#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

namespace plano_fuzz {

class InputFile {
public:
    explicit InputFile(const char *tag) : fd_(::memfd_create(tag, MFD_CLOEXEC))
    {
        if (fd_ < 0) fail("memfd_create");
        path_ = "/proc/self/fd/" + std::to_string(fd_);
    }
    InputFile(const InputFile &) = delete;
    InputFile &operator=(const InputFile &) = delete;
    ~InputFile() { ::close(fd_); }

    // Replaces the file's contents with the bytes and returns its path; aborts when it
    // cannot, since every later run would then test nothing.
    const std::string &write(const uint8_t *data, size_t size) const
    {
        if (::ftruncate(fd_, 0) != 0) fail("ftruncate");
        for (size_t done = 0; done < size;) {
            ssize_t n = ::pwrite(fd_, data + done, size - done, static_cast<off_t>(done));
            if (n <= 0) fail("pwrite");
            done += static_cast<size_t>(n);
        }
        return path_;
    }

private:
    [[noreturn]] static void fail(const char *what)
    {
        std::perror(what);
        std::abort();
    }

    int fd_;
    std::string path_;
};

}  // namespace plano_fuzz

#endif
