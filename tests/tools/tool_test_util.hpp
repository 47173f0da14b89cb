// Running the built `plano` tool from tests, and small image helpers.
#ifndef PLANO_TESTS_TOOLS_TOOL_TEST_UTIL_HPP
#define PLANO_TESTS_TOOLS_TOOL_TEST_UTIL_HPP

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <OpenImageIO/imageio.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

namespace tool_test {

namespace fs = std::filesystem;

struct ToolRun {
    int code = -1;
    std::string out, err;
    // Lines of stderr (without the final newline).
    size_t error_lines() const
    {
        size_t n = 0;
        for (char c : err) n += c == '\n';
        return n;
    }
};

inline std::string slurp(const fs::path &path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

inline std::string quoted(const std::string &s)
{
    std::string q = "'";
    for (char c : s) {
        if (c == '\'') q += "'\\''";
        else q += c;
    }
    q += '\'';
    return q;
}

// A folder of its own for each test.
inline fs::path test_dir()
{
    const auto *info = ::testing::UnitTest::GetInstance()->current_test_info();
    fs::path dir = fs::temp_directory_path() / "plano_tool_test" / (std::string(info->test_suite_name()) + "." + info->name());
    fs::remove_all(dir);
    fs::create_directories(dir);
    return dir;
}

// Runs the tool with its arguments (no shell interpretation of them) in dir; shell_prefix
// (for example "ulimit -f 8 &&") runs before it in the same shell.
inline ToolRun run_tool(const fs::path &dir, const std::vector<std::string> &args, const std::string &shell_prefix = "")
{
    std::string command = "cd " + quoted(dir.string()) + " && " + shell_prefix + " " + quoted(PLANO_TOOL_PATH);
    for (const std::string &a : args) {
        command += ' ';
        command += quoted(a);
    }
    command += " >";
    command += quoted((dir / "stdout.txt").string());
    command += " 2>";
    command += quoted((dir / "stderr.txt").string());
    command += " </dev/null";
    int status = std::system(command.c_str());
    ToolRun r;
    r.code = WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + (WIFSIGNALED(status) ? WTERMSIG(status) : 0);
    r.out = slurp(dir / "stdout.txt");
    r.err = slurp(dir / "stderr.txt");
    return r;
}

// A failure as the tool reports one: exit code `code` (0: any failure code, but not a crash),
// one line on stderr that starts with "plano" and holds `says`.
inline void expect_one_line_failure(const ToolRun &r, const std::string &says, int code = 0)
{
    if (code != 0) {
        EXPECT_EQ(r.code, code) << says << ": " << r.err;
    } else {
        EXPECT_NE(r.code, 0) << says;
        EXPECT_LT(r.code, 256) << says << " (crashed?)";
    }
    EXPECT_EQ(r.error_lines(), 1u) << says << ": " << r.err;
    EXPECT_EQ(r.err.rfind("plano", 0), 0u) << r.err;
    EXPECT_NE(r.err.find(says), std::string::npos) << says << ": " << r.err;
}

struct Pixels {
    int width = 0, height = 0, channels = 0;
    OIIO::TypeDesc format;
    std::vector<float> data;
    float at(int x, int y, int c) const { return data[(static_cast<size_t>(y) * width + x) * channels + c]; }
};

inline Pixels read_pixels(const fs::path &path)
{
    Pixels p;
    auto in = OIIO::ImageInput::open(path.string());
    if (!in) {
        ADD_FAILURE() << "cannot read " << path;
        return p;
    }
    const OIIO::ImageSpec &spec = in->spec();
    p.width = spec.width;
    p.height = spec.height;
    p.channels = spec.nchannels;
    p.format = spec.format;
    p.data.resize(static_cast<size_t>(p.width) * p.height * p.channels);
    in->read_image(0, 0, 0, p.channels, OIIO::TypeDesc::FLOAT, p.data.data());
    return p;
}

inline void write_pixels(const fs::path &path, const Pixels &p, OIIO::TypeDesc format)
{
    fs::create_directories(path.parent_path());
    auto out = OIIO::ImageOutput::create(path.string());
    ASSERT_TRUE(out);
    OIIO::ImageSpec spec(p.width, p.height, p.channels, format);
    ASSERT_TRUE(out->open(path.string(), spec));
    ASSERT_TRUE(out->write_image(OIIO::TypeDesc::FLOAT, p.data.data()));
    out->close();
}

inline Pixels flat(int width, int height, std::vector<float> value)
{
    Pixels p;
    p.width = width;
    p.height = height;
    p.channels = static_cast<int>(value.size());
    for (int i = 0; i < width * height; ++i) p.data.insert(p.data.end(), value.begin(), value.end());
    return p;
}

inline size_t count_files(const fs::path &dir)
{
    if (!fs::exists(dir)) return 0;
    size_t n = 0;
    for (const auto &e : fs::directory_iterator(dir)) n += e.is_regular_file();
    return n;
}

}  // namespace tool_test

#endif
