// The tool with hostile input and failing disks: outputs never land on inputs or replace a
// good result with a worse one, and bad input of every kind is refused on one line.
#if defined(PLANO_TOOL_PATH)

#include <sys/resource.h>

#include <cmath>

#include "tool_test_util.hpp"

namespace {

using namespace tool_test;
using nlohmann::json;

const std::string kPlates = "demo/plates/frame.%04d.png";
const std::string kQuad = "120,60,280,60,280,200,120,200";

class ToolSafety : public ::testing::Test {
protected:
    void SetUp() override
    {
        dir_ = test_dir();
        ToolRun r = run_tool(dir_, {"demo", "-o", "demo", "-n", "5", "-q"});
        ASSERT_EQ(r.code, 0) << r.err;
    }
    ToolRun track(std::vector<std::string> extra, const std::string &shell_prefix = "")
    {
        std::vector<std::string> args = {"track", "-s", kPlates, "--quad", kQuad, "-q"};
        args.insert(args.end(), extra.begin(), extra.end());
        return run_tool(dir_, args, shell_prefix);
    }
    // Hidden temporaries left in a folder.
    size_t leftovers(const fs::path &folder)
    {
        size_t n = 0;
        for (const auto &e : fs::directory_iterator(folder)) n += e.path().filename().string().rfind(".plano-", 0) == 0;
        return n;
    }
    fs::path dir_;
};

// An output that is an input, or two outputs on one file, is refused before anything is
// written: the plates stay byte for byte.
TEST_F(ToolSafety, OutputsNeverOverwriteInputs)
{
    const std::string plate = slurp(dir_ / "demo/plates/frame.0002.png");
    fs::create_symlink("demo/plates/frame.0003.png", dir_ / "link.png");
    std::ofstream(dir_ / "keys.shk") << "placeholder";
    struct Case {
        std::vector<std::string> args;
        const char *says;
    };
    const std::vector<Case> cases = {
        {{"track", "-s", kPlates, "--quad", kQuad, "-o", "demo/plates/frame.0002.png"}, "would overwrite the input"},
        {{"track", "-s", kPlates, "--quad", kQuad, "--csv", "demo/plates/../plates/frame.0002.png"},
         "would overwrite the input"},
        {{"track", "-s", kPlates, "--quad", kQuad, "--script", "link.png"}, "would overwrite the input"},
        {{"track", "-s", kPlates, "--quad", kQuad, "-o", "a.json", "--csv", "./a.json"}, "both write"},
        {{"track", "-s", kPlates, "--init-from", "keys.shk", "--script", "keys.shk"}, "would overwrite the input"},
        {{"overlay", "-t", "demo/track.json", "-o", kPlates}, "would overwrite the input"},
        {{"insert", "-t", "demo/track.json", "-i", "demo/plates/frame.0001.png", "-o", "demo/plates/frame.%04d.png"},
         "would overwrite the input"},
    };
    for (const Case &c : cases) expect_one_line_failure(run_tool(dir_, c.args), c.says, 1);
    EXPECT_EQ(slurp(dir_ / "demo/plates/frame.0002.png"), plate);
    EXPECT_FALSE(fs::exists(dir_ / "a.json"));
    EXPECT_EQ(slurp(dir_ / "keys.shk"), "placeholder");
}

// A complete earlier result survives a re-run that fails part-way (its partial result goes
// beside it) and a re-run whose writes fail (past a file-size limit, as on a full disk).
TEST_F(ToolSafety, EarlierResultsSurviveFailedRuns)
{
    ASSERT_EQ(track({"-o", "t.json", "--csv", "t.csv", "--script", "t.shk"}).code, 0);
    const std::string json_text = slurp(dir_ / "t.json"), csv = slurp(dir_ / "t.csv"), script = slurp(dir_ / "t.shk");

    ToolRun r = track({"-o", "t.json", "--csv", "t.csv", "--script", "t.shk", "--iterations", "20"}, "ulimit -f 8 &&");
    expect_one_line_failure(r, "cannot write", 1);
    EXPECT_EQ(slurp(dir_ / "t.json"), json_text);
    EXPECT_EQ(slurp(dir_ / "t.csv"), csv);
    EXPECT_EQ(slurp(dir_ / "t.shk"), script);
    EXPECT_EQ(leftovers(dir_), 0u);

    // Frame 4 cut short: the run stops there, keeps t.json and writes frames 1-3 beside it.
    fs::path cut = dir_ / "demo/plates/frame.0004.png";
    fs::resize_file(cut, fs::file_size(cut) / 2);
    r = track({"-o", "t.json", "--csv", "t.csv"});
    expect_one_line_failure(r, "'t.json' kept", 1);
    EXPECT_EQ(slurp(dir_ / "t.json"), json_text);
    EXPECT_EQ(slurp(dir_ / "t.csv"), csv);
    json partial = json::parse(slurp(dir_ / "t.partial.json"));
    EXPECT_FALSE(partial["complete"].get<bool>());
    EXPECT_EQ(partial["frames"].size(), 3u);
    EXPECT_EQ(partial["stopped"].get<std::string>().find('\n'), std::string::npos);
    EXPECT_TRUE(fs::exists(dir_ / "t.partial.csv"));
}

// Damaged frames anywhere in a sequence fail on one line naming the file (the image
// library's own text stays off the terminal), or are marked and passed over when asked.
TEST_F(ToolSafety, DamagedFramesAreErrorsOrMarked)
{
    for (int f = 1; f <= 5; ++f) {
        char png[64], jpg[64];
        std::snprintf(png, sizeof png, "demo/plates/frame.%04d.png", f);
        std::snprintf(jpg, sizeof jpg, "jpg/frame.%04d.jpg", f);
        write_pixels(dir_ / jpg, read_pixels(dir_ / png), OIIO::TypeDesc::UINT8);
    }
    for (const char *name : {"jpg/frame.0003.jpg", "demo/plates/frame.0003.png"})
        fs::resize_file(dir_ / name, fs::file_size(dir_ / name) / 2);
    for (const std::string &plates : {std::string("jpg/frame.%04d.jpg"), kPlates}) {
        ToolRun r = run_tool(dir_, {"track", "-s", plates, "--quad", kQuad, "-o", "d.json", "-q"});
        expect_one_line_failure(r, "frame.0003", 1);
        fs::remove(dir_ / "d.json");
        r = run_tool(dir_, {"track", "-s", plates, "--quad", kQuad, "-o", "c.json", "--on-lost", "continue"});
        ASSERT_EQ(r.code, 0) << r.err;
        EXPECT_NE(r.err.find("1 frame unreadable"), std::string::npos) << r.err;
        json c = json::parse(slurp(dir_ / "c.json"));
        ASSERT_EQ(c["frames"].size(), 5u);
        EXPECT_EQ(c["frames"][2]["status"], "unreadable");
        EXPECT_NE(c["frames"][2]["reason"].get<std::string>().find("frame.0003"), std::string::npos);
        EXPECT_EQ(c["frames"][3]["status"], "ok");
    }
}

std::string script_text(const std::string &dimensions, const std::vector<std::pair<std::string, std::string>> &keys)
{
    // Keys as (x value, frame); every curve gets the same keys.
    std::string s = "# This corresponds to file numbers 1-5 in the original clip\n" + dimensions +
                    "MatchMove1 = MatchMove(0, 0, 1, \"4 point\",\n";
    for (int curve = 0; curve < 8; ++curve) {
        s += "   Linear(0";
        for (const auto &[value, frame] : keys) s += "," + value + "@" + frame;
        s += curve == 1 || curve == 3 ? "), 1, 1,\n" : "),\n";
    }
    return s;
}

// Inputs outside what a writer would write, or beyond what one input may cost, are refused
// on one line; numbers the options cannot take too.
TEST_F(ToolSafety, HostileInputsAreRefused)
{
    const std::string dims = "# Image dimensions 400x260\n";
    const std::vector<std::pair<const char *, std::string>> scripts = {
        {"nan.shk", script_text(dims, {{"nan", "1"}, {"150", "2"}})},
        {"none.shk", script_text(dims, {})},
        {"twice.shk", script_text(dims, {{"150", "1"}, {"150", "1"}})},
        {"huge.shk", script_text(dims, {{"150", "1"}, {"150", "3000000000"}})},
        {"zero.shk", script_text("# Image dimensions 0x0\n", {{"150", "1"}})},
    };
    for (const auto &[name, text] : scripts) std::ofstream(dir_ / name) << text;
    json wrapped = json::parse(slurp(dir_ / "demo/track.json"));
    wrapped["frames"][1]["frame"] = 99999999999;
    std::ofstream(dir_ / "wrapped.json") << wrapped.dump();
    json ragged = json::parse(slurp(dir_ / "demo/track.json"));
    ragged["frames"][1]["information"] = {{1, 0}, {0}};
    std::ofstream(dir_ / "ragged.json") << ragged.dump();
    // A header-only image far over the pixel cap: refused before its pixels are read.
    std::ofstream(dir_ / "big.pgm") << "P5\n20000 20000\n255\n" << std::string(64, '\0');

    struct Case {
        std::vector<std::string> args;
        const char *says;
    };
    const std::vector<Case> cases = {
        {{"track", "-s", kPlates, "--init-from", "nan.shk"}, "not a finite number"},
        {{"track", "-s", kPlates, "--init-from", "none.shk"}, "has no keys"},
        {{"track", "-s", kPlates, "--init-from", "twice.shk"}, "out of order or twice"},
        {{"track", "-s", kPlates, "--init-from", "huge.shk"}, "out of range"},
        {{"track", "-s", kPlates, "--init-from", "zero.shk"}, "dimensions 0x0"},
        {{"track", "-s", kPlates, "--init-from", "/dev/zero"}, "not a regular file"},
        {{"track", "-s", kPlates, "--mask", "big.pgm"}, "million pixels"},
        {{"overlay", "-t", "wrapped.json", "-o", "o/%04d.png"}, "out of range"},
        {{"overlay", "-t", "ragged.json", "-o", "o/%04d.png"}, "not a square matrix"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/%04d.png", "--colour", "nan,0,0"}, "not three numbers"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/%04d.png", "--thickness", "nan"}, "thickness"},
        {{"insert", "-t", "demo/track.json", "-i", "demo/card.png", "-o", "o/%04d.png", "--feather", "inf"}, "feather"},
        {{"track", "-s", kPlates, "--quad", kQuad, "--rotation-range", "nan"}, "rotation range"},
        {{"track", "-s", kPlates, "--quad", kQuad, "--iterations", "100000"}, "iterations"},
        {{"track", "-s", kPlates, "--quad", kQuad, "-j", "100000"}, "threads"},
    };
    for (const Case &c : cases) expect_one_line_failure(run_tool(dir_, c.args), c.says, 1);
    EXPECT_FALSE(fs::exists(dir_ / "o"));

    // A search range far past the plate is cut to it: the run succeeds within bounded memory
    // (uncut, this range asked for tens of gigabytes).
    ToolRun r = track({"--search-range", "20000", "-o", "wide.json"});
    EXPECT_EQ(r.code, 0) << r.err;
    rusage usage{};
    getrusage(RUSAGE_CHILDREN, &usage);
    EXPECT_LT(usage.ru_maxrss, 1500 * 1024) << "kilobytes";
}

// Where the inserted image covers a plate fully, nothing of the plate shows through, not
// even an infinity (which would otherwise turn the pixel into NaN).
TEST(ToolInsert, CoveredInfinitiesDoNotSpread)
{
    fs::path dir = test_dir();
    write_pixels(dir / "red.png", flat(8, 8, {1, 0, 0}), OIIO::TypeDesc::UINT8);
    Pixels plate = flat(64, 48, {0.5f, 0.25f, 0.125f});
    for (auto [x, y] : {std::pair{32, 24}, std::pair{5, 5}})
        for (int c = 0; c < 3; ++c) plate.data[(y * 64 + x) * 3 + c] = INFINITY;
    write_pixels(dir / "p.0001.exr", plate, OIIO::TypeDesc::FLOAT);
    json frames = json::array({{{"frame", 1},
                                {"status_code", 0},
                                {"homography", {{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}},
                                {"corners", {{16, 12}, {48, 12}, {48, 36}, {16, 36}}}}});
    std::ofstream(dir / "track.json") << json{{"sequence", "p.%04d.exr"}, {"width", 64}, {"height", 48}, {"frames", frames}}.dump();
    ToolRun r = run_tool(dir, {"insert", "-t", "track.json", "-i", "red.png", "-o", "o.%04d.exr", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    Pixels out = read_pixels(dir / "o.0001.exr");
    for (int c = 0; c < 3; ++c) {
        EXPECT_EQ(out.at(32, 24, c), c == 0 ? 1.0f : 0.0f) << c;
        EXPECT_EQ(out.at(5, 5, c), INFINITY) << c;  // uncovered: the plate as it was
    }
}

}  // namespace

#endif  // PLANO_TOOL_PATH
