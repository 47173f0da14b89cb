// End-to-end tests of the `plano` tool: the demo, insertion, overlays, the files it writes and
// its failures, run as a user runs it.
#if defined(PLANO_TOOL_PATH)

#include <cmath>

#include "plano/matchmove.h"
#include "plano/plano.h"
#include "tool_test_util.hpp"

namespace {

using namespace tool_test;
using nlohmann::json;

constexpr int kDemoFrames = 6;

// The card's geometry as the demo draws it: 256 pixels square, a white bar over the top 24
// rows, a grid every 32 pixels, and a blue top-left quarter.
constexpr double kCardSize = 256;
const float kCardBlue[3] = {0.15f, 0.25f, 0.85f};

std::array<double, 2> corner(const json &q, int i) { return {q[i][0].get<double>(), q[i][1].get<double>()}; }

// Where point (u, v) of a w x h image lands when its corners go onto quad q (clockwise from
// top-left), through the library's corner pin.
std::array<double, 2> through_quad(const json &q, double w, double h, double u, double v)
{
    const double tex[4][2] = {{0, 0}, {w, 0}, {0, h}, {w, h}};
    const int order[4] = {0, 1, 3, 2};
    Plx_Vector3 scene[4], texture[4];
    for (int i = 0; i < 4; ++i) {
        auto c = corner(q, order[i]);
        scene[i] = {c[0], c[1], 1};
        texture[i] = {tex[i][0], tex[i][1], 1};
    }
    Plx_Matrix33 H;
    EXPECT_TRUE(bTex2Scene(scene, texture, nullptr, nullptr, &H));
    double x = H.m[0][0] * u + H.m[0][1] * v + H.m[0][2];
    double y = H.m[1][0] * u + H.m[1][1] * v + H.m[1][2];
    double z = H.m[2][0] * u + H.m[2][1] * v + H.m[2][2];
    return {x / z, y / z};
}

class ToolDemo : public ::testing::Test {
protected:
    void SetUp() override
    {
        dir_ = test_dir();
        ToolRun r = run_tool(dir_, {"demo", "-o", "demo", "-n", std::to_string(kDemoFrames), "-q", "-j", "2"});
        ASSERT_EQ(r.code, 0) << r.err;
        demo_ = dir_ / "demo";
        track_ = json::parse(slurp(demo_ / "track.json"));
    }
    fs::path dir_, demo_;
    json track_;
};

TEST_F(ToolDemo, ShotTrackAndCompositeWithinAccuracy)
{
    EXPECT_EQ(count_files(demo_ / "plates"), size_t(kDemoFrames));
    EXPECT_EQ(count_files(demo_ / "comp"), size_t(kDemoFrames));
    ASSERT_EQ(track_["frames"].size(), size_t(kDemoFrames));
    EXPECT_EQ(track_["width"], 400);
    EXPECT_EQ(track_["height"], 260);

    // Tracked corners against the known camera move.
    double worst = 0;
    for (const json &f : track_["frames"]) {
        ASSERT_EQ(f["status"], "ok") << f["frame"];
        for (int i = 0; i < 4; ++i) {
            auto a = corner(f["corners"], i), b = corner(f["true_corners"], i);
            worst = std::max(worst, std::hypot(a[0] - b[0], a[1] - b[1]));
        }
    }
    EXPECT_LT(worst, 1.0);

    // The card lands where the corners say, and the plate is untouched away from it.
    for (int f : {1, kDemoFrames}) {
        const json &frame = track_["frames"][f - 1];
        char name[32];
        std::snprintf(name, sizeof name, "frame.%04d.png", f);
        Pixels comp = read_pixels(demo_ / "comp" / name), plate = read_pixels(demo_ / "plates" / name);
        ASSERT_EQ(comp.width, 400);
        // Inside a cell of the blue quarter, away from grid lines and edges.
        auto p = through_quad(frame["corners"], kCardSize, kCardSize, 80, 80);
        for (int c = 0; c < 3; ++c)
            EXPECT_NEAR(comp.at(int(p[0]), int(p[1]), c), kCardBlue[c], 3.0 / 255) << f << " " << c;
        // In the white bar.
        p = through_quad(frame["corners"], kCardSize, kCardSize, 128, 12);
        EXPECT_NEAR(comp.at(int(p[0]), int(p[1]), 0), 1.0, 2.0 / 255);
        for (auto [x, y] : {std::pair{3, 3}, std::pair{396, 250}, std::pair{20, 130}})
            for (int c = 0; c < 3; ++c) EXPECT_EQ(comp.at(x, y, c), plate.at(x, y, c)) << x << "," << y;
    }
    EXPECT_NE(slurp(dir_ / "stdout.txt").find("output: "), std::string::npos);
}

TEST_F(ToolDemo, JsonRoundTripRendersTheSameFrames)
{
    ToolRun r = run_tool(dir_, {"insert", "-t", "demo/track.json", "-i", "demo/card.png", "-o", "again/f.####.png",
                            "--feather", "1.5", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    for (int f = 1; f <= kDemoFrames; ++f) {
        char a[32], b[32];
        std::snprintf(a, sizeof a, "comp/frame.%04d.png", f);
        std::snprintf(b, sizeof b, "again/f.%04d.png", f);
        Pixels x = read_pixels(demo_ / a), y = read_pixels(dir_ / b);
        EXPECT_EQ(x.data, y.data) << f;
    }
    // Only the requested range is rendered.
    r = run_tool(dir_, {"insert", "-t", "demo/track.json", "-i", "demo/card.png", "-o", "part/f.%02d.png", "-f",
                        "2-3", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    EXPECT_EQ(count_files(dir_ / "part"), 2u);
    EXPECT_TRUE(fs::exists(dir_ / "part" / "f.02.png"));
}

TEST_F(ToolDemo, ScriptHoldsTheJsonCornersToSixDecimals)
{
    int32_t height = 0, width = 0;
    char node[64];
    Plx_List *keys = nullptr;
    ASSERT_TRUE(bReadShakeMatchMoveFile((demo_ / "track.shk").string().c_str(), &height, &width, node, sizeof node, &keys));
    EXPECT_EQ(width, 400);
    EXPECT_EQ(height, 260);
    EXPECT_STREQ(node, "DemoCorners");
    ASSERT_EQ(plx_list_get_size(keys), uint32_t(kDemoFrames));
    int i = 0;
    for (const Plx_ListNode *n = keys->head; n != nullptr; n = n->next, ++i) {
        const auto *key = static_cast<const MatchMoveKey *>(n->data);
        const json &f = track_["frames"][i];
        EXPECT_EQ(key->frame, f["frame"].get<uint32_t>());
        for (int c = 0; c < 4; ++c) {
            auto p = corner(f["corners"], c);
            EXPECT_NEAR(key->corners[c][0], p[0], 5.0001e-7);
            EXPECT_NEAR(key->corners[c][1], p[1], 5.0001e-7);
        }
    }
    plx_list_free(keys, free);
}

TEST_F(ToolDemo, OverlayDrawsEachQuad)
{
    ToolRun r = run_tool(dir_, {"overlay", "-t", "demo/track.json", "-o", "review/r.%04d.png", "--colour", "0,1,0",
                            "--thickness", "3", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    ASSERT_EQ(count_files(dir_ / "review"), size_t(kDemoFrames));
    Pixels review = read_pixels(dir_ / "review" / "r.0003.png"), plate = read_pixels(demo_ / "plates" / "frame.0003.png");
    ASSERT_EQ(review.channels, 3);
    const json &q = track_["frames"][2]["corners"];
    for (int e = 0; e < 4; ++e) {
        auto a = corner(q, e), b = corner(q, (e + 1) % 4);
        int x = int((a[0] + b[0]) / 2), y = int((a[1] + b[1]) / 2);
        EXPECT_EQ(review.at(x, y, 0), 0.0f) << e;
        EXPECT_EQ(review.at(x, y, 1), 1.0f) << e;
    }
    // The middle of the quad and the far corner are the plate's.
    auto c = through_quad(q, 1, 1, 0.5, 0.5);
    for (int k = 0; k < 3; ++k) {
        EXPECT_EQ(review.at(int(c[0]), int(c[1]), k), plate.at(int(c[0]), int(c[1]), k));
        EXPECT_EQ(review.at(399, 259, k), plate.at(399, 259, k));
    }
}

// A hand-written track over plates the test makes: 16-bit TIFF and float EXR plates keep
// their depth, the insert fills the quad, and a frame that was not tracked keeps its plate.
TEST(ToolInsert, PlatesKeepTheirDepthAndUntrackedFramesTheirPlate)
{
    fs::path dir = test_dir();
    write_pixels(dir / "red.png", flat(8, 8, {1, 0, 0}), OIIO::TypeDesc::UINT8);
    struct Case {
        const char *plates, *written, *out, *read_out;
        OIIO::TypeDesc depth;
    };
    for (const Case &k : {Case{"p16.%04d.tif", "p16.%04d.tif", "o16/%04d.tif", "o16/%04d.tif", OIIO::TypeDesc::UINT16},
                          Case{"pf.####.exr", "pf.%04d.exr", "of/####.exr", "of/%04d.exr", OIIO::TypeDesc::FLOAT}}) {
        json frames = json::array();
        for (int f = 1; f <= 3; ++f) {
            char name[64];
            std::snprintf(name, sizeof name, k.written, f);
            write_pixels(dir / name, flat(64, 48, {0.5f, 0.25f, 0.125f}), k.depth);
            frames.push_back({{"frame", f},
                              {"status_code", f == 2 ? 1 : 0},
                              {"homography", {{1, 0, 0}, {0, 1, 0}, {0, 0, 1}}},
                              {"corners", {{16, 12}, {48, 12}, {48, 36}, {16, 36}}}});
        }
        json track = {{"sequence", k.plates}, {"width", 64}, {"height", 48}, {"frames", frames}};
        std::ofstream(dir / "track.json") << track.dump();
        ToolRun r = run_tool(dir, {"insert", "-t", "track.json", "-i", "red.png", "-o", k.out, "-q"});
        ASSERT_EQ(r.code, 0) << r.err;
        for (int f = 1; f <= 3; ++f) {
            char name[64], plate_name[64];
            std::snprintf(name, sizeof name, k.read_out, f);
            std::snprintf(plate_name, sizeof plate_name, k.written, f);
            Pixels out = read_pixels(dir / name), plate = read_pixels(dir / plate_name);
            ASSERT_EQ(out.format, k.depth) << name;
            ASSERT_EQ(out.channels, 3);
            bool tracked = f != 2;
            // Inside the quad and outside it, away from its soft edge (one insert pixel, here
            // four plate pixels, across).
            for (auto [x, y] : {std::pair{20, 15}, std::pair{43, 32}, std::pair{32, 24}})
                for (int c = 0; c < 3; ++c)
                    EXPECT_NEAR(out.at(x, y, c), tracked ? (c == 0 ? 1.0f : 0.0f) : plate.at(x, y, c), 1e-6)
                        << name << " " << x << "," << y;
            for (auto [x, y] : {std::pair{5, 5}, std::pair{60, 40}, std::pair{8, 24}, std::pair{56, 24}})
                for (int c = 0; c < 3; ++c) EXPECT_EQ(out.at(x, y, c), plate.at(x, y, c)) << name;
        }
    }
}

// Each failure: a non-zero exit and one line naming the command and the reason.
TEST(ToolErrors, OneLineAndNonZero)
{
    fs::path dir = test_dir();
    ToolRun demo = run_tool(dir, {"demo", "-o", "demo", "-n", "3", "-q"});
    ASSERT_EQ(demo.code, 0) << demo.err;
    std::ofstream(dir / "garbage.png") << "not an image";
    fs::create_directories(dir / "bad");
    fs::copy_file(dir / "garbage.png", dir / "bad" / "frame.0002.png");
    for (int f : {1, 3}) {
        char name[64];
        std::snprintf(name, sizeof name, "frame.%04d.png", f);
        fs::copy_file(dir / "demo" / "plates" / name, dir / "bad" / name);
    }
    std::ofstream(dir / "broken.json") << "{\"width\": 400, \"frames\": [";

    struct Case {
        std::vector<std::string> args;
        const char *says;
    };
    const std::vector<Case> cases = {
        {{"insert", "-t", "missing.json", "-i", "demo/card.png", "-o", "o/%04d.png"}, "missing.json': no such file"},
        {{"insert", "-t", "broken.json", "-i", "demo/card.png", "-o", "o/%04d.png"}, "not a tracking result"},
        {{"insert", "-t", "demo/track.json", "-i", "garbage.png", "-o", "o/%04d.png"}, "cannot read 'garbage.png'"},
        {{"insert", "-t", "demo/track.json", "-i", "demo/card.png", "-o", "o/%04d.png", "-s", "nowhere/p.%04d.png"},
         "no such file"},
        {{"overlay", "-t", "demo/track.json", "-o", "partial/%04d.png", "-s", "bad/frame.%04d.png"},
         "cannot read 'bad/frame.0002.png'"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/frame.png"}, "exactly one frame number field"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/%04d_%04d.png"}, "exactly one frame number field"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/##_##.png"}, "more than one run"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/%4d.png"}, "pad with zeros"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/%04d.png", "-f", "5-2"}, "ends before it starts"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/%04d.png", "-f", "7-9"}, "no tracked frames"},
        {{"overlay", "-t", "demo/track.json", "-o", "o/%04d.png", "--colour", "1,2"}, "not three numbers"},
        {{"insert", "-t", "demo/track.json", "-i", "demo/card.png", "-o", "o/%04d.png", "--feather=-1"},
         "feather"},
        {{"insert", "-i", "demo/card.png", "-o", "o/%04d.png"}, "--track is required"},
        {{"nonsense"}, "plano: "},
    };
    for (const Case &c : cases) expect_one_line_failure(run_tool(dir, c.args), c.says);
    // Failures before the first frame leave no output behind; a failure at a later frame
    // keeps the frames before it (and says which frame failed).
    EXPECT_FALSE(fs::exists(dir / "o"));
    EXPECT_EQ(count_files(dir / "partial"), 1u);
}

json track_of(const fs::path &path) { return json::parse(slurp(path)); }

double worst_corner_error(const json &a, const json &truth)
{
    double worst = 0;
    for (const json &f : a["frames"]) {
        const json &t = truth["frames"][f["frame"].get<int>() - 1];
        for (int i = 0; i < 4; ++i) {
            auto p = corner(f["corners"], i), q = corner(t["true_corners"], i);
            worst = std::max(worst, std::hypot(p[0] - q[0], p[1] - q[1]));
        }
    }
    return worst;
}

TEST(ToolTrack, TracksBothWaysAndWritesEveryFormat)
{
    fs::path dir = test_dir();
    ASSERT_EQ(run_tool(dir, {"demo", "-o", "demo", "-n", "8", "-q"}).code, 0);
    json truth = track_of(dir / "demo" / "track.json");
    // The region at frame 4, from the known move, tracked forwards to 8 and backwards to 1.
    std::string quad;
    for (int i = 0; i < 4; ++i) {
        auto c = corner(truth["frames"][3]["true_corners"], i);
        char text[64];
        std::snprintf(text, sizeof text, "%s%.6f,%.6f", i ? "," : "", c[0], c[1]);
        quad += text;
    }
    ToolRun r = run_tool(dir, {"track", "-s", "demo/plates/frame.%04d.png", "-r", "4", "--quad", quad, "-o", "t.json",
                           "--csv", "t.csv", "--script", "t.shk", "--search-range", "24", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    json t = track_of(dir / "t.json");
    EXPECT_TRUE(t["complete"].get<bool>());
    ASSERT_EQ(t["frames"].size(), 8u);
    EXPECT_EQ(t["frames"][0]["frame"], 1);
    EXPECT_LT(worst_corner_error(t, truth), 1.0);
    std::string csv = slurp(dir / "t.csv");
    EXPECT_EQ(std::count(csv.begin(), csv.end(), '\n'), 9);

    // Starting again from the script gives the same track.
    r = run_tool(dir, {"track", "-s", "demo/plates/frame.%04d.png", "-r", "4", "--init-from", "t.shk", "-o", "u.json",
                       "--search-range", "24", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    EXPECT_LT(worst_corner_error(track_of(dir / "u.json"), truth), 1.0);
}

TEST(ToolTrack, FailuresAreOneLine)
{
    fs::path dir = test_dir();
    ASSERT_EQ(run_tool(dir, {"demo", "-o", "demo", "-n", "4", "-q"}).code, 0);
    std::ofstream(dir / "bad.shk") << "# This corresponds to file numbers 1-3 in the original clip\nnot a node\n";
    const std::string plates = "demo/plates/frame.%04d.png";
    struct Case {
        std::vector<std::string> args;
        int code;
        const char *says;
    };
    const std::vector<Case> cases = {
        {{"track", "-s", plates, "--quad=-5,10,100,10,100,100,10,100"}, 1, "outside"},
        {{"track", "-s", plates, "--quad", "10,10,100,100,100,10,10,100"}, 1, "twisted"},
        {{"track", "-s", plates, "--quad", "1,2,3"}, 1, "eight numbers"},
        {{"track", "-s", plates, "--init-from", "bad.shk"}, 1, "code 26"},
        {{"track", "-s", plates, "--init-from", "nope.shk"}, 1, "'nope.shk': no such file"},
        {{"track", "-s", "demo/plates/frame.png", "--quad", "10,10,100,10,100,100,10,100"}, 1, "frame number field"},
        {{"track", "-s", "none/f.%04d.png", "--quad", "10,10,100,10,100,100,10,100"}, 1, "no files match"},
        {{"track", "-s", plates, "-f", "1-5", "--quad", "10,10,100,10,100,100,10,100"}, 1, "no such file"},
        {{"track", "-s", plates, "--quad", "10,10,100,10,100,100,10,100", "-m", "bendy"}, 1, "unknown motion model"},
    };
    for (const Case &c : cases) expect_one_line_failure(run_tool(dir, c.args), c.says, c.code);

    // A region that disappears: frame 3 is black. Tracking stops there, says so and keeps
    // what it had.
    Pixels black = read_pixels(dir / "demo" / "plates" / "frame.0003.png");
    std::fill(black.data.begin(), black.data.end(), 0.0f);
    write_pixels(dir / "demo" / "plates" / "frame.0003.png", black, OIIO::TypeDesc::UINT8);
    ToolRun r = run_tool(dir, {"track", "-s", plates, "--quad", "120,60,280,60,280,200,120,200", "-o", "lost.json", "-q"});
    expect_one_line_failure(r, "lost at frame 3", 3);
    json lost = track_of(dir / "lost.json");
    EXPECT_FALSE(lost["complete"].get<bool>());
    ASSERT_EQ(lost["frames"].size(), 3u);
    EXPECT_EQ(lost["frames"][1]["status"], "ok");
    EXPECT_NE(lost["frames"][2]["status"], "ok");

    // Told to go on, it marks the frame and picks the region up again on the next one.
    r = run_tool(dir, {"track", "-s", plates, "--quad", "120,60,280,60,280,200,120,200", "-o", "on.json",
                       "--on-lost", "continue"});
    EXPECT_EQ(r.code, 0) << r.err;
    EXPECT_NE(r.err.find("1 frame lost"), std::string::npos) << r.err;
    json on = track_of(dir / "on.json");
    EXPECT_TRUE(on["complete"].get<bool>());
    ASSERT_EQ(on["frames"].size(), 4u);
    EXPECT_NE(on["frames"][2]["status"], "ok");
    EXPECT_EQ(on["frames"][3]["status"], "ok");
}

}  // namespace

#else

#include <gtest/gtest.h>

TEST(Tool, NotBuilt) { GTEST_SKIP() << "the plano tool is not built (OpenImageIO, CLI11 or nlohmann/json missing)"; }

#endif  // PLANO_TOOL_PATH
