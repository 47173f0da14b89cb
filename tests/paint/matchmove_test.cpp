// Match-move scripts: the writer's exact text, reading back, renumbering and malformed files.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "plano/matchmove.h"
#include "plano/plano.h"

namespace {

namespace fs = std::filesystem;

int32_t origin_code()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.code : -1;
}

std::string origin_function()
{
    Plx_ErrorRecord r;
    return plx_err_get_error(0, &r) ? r.function : "";
}

// A file name of its own for each test, so that tests may run side by side.
std::string temp_path(const std::string &name)
{
    const auto *info = ::testing::UnitTest::GetInstance()->current_test_info();
    fs::path dir = fs::temp_directory_path() / "plano_matchmove_test";
    fs::create_directories(dir);
    return (dir / (std::string(info->name()) + "_" + name)).string();
}

std::string slurp(const std::string &path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

void spit(const std::string &path, const std::string &text)
{
    std::ofstream out(path, std::ios::binary);
    out << text;
}

// Owns a list of heap keys.
struct KeyList {
    Plx_List *list = plx_list_new();
    ~KeyList() { plx_list_free(list, free); }
    void add(uint32_t frame, std::initializer_list<double> xy)
    {
        auto *key = static_cast<MatchMoveKey *>(std::malloc(sizeof(MatchMoveKey)));
        key->frame = frame;
        auto v = xy.begin();
        for (auto &corner : key->corners) {
            corner[0] = *v++;
            corner[1] = *v++;
        }
        plx_list_insert_last(list, key);
    }
};

std::vector<MatchMoveKey> keys_of(const Plx_List *list)
{
    std::vector<MatchMoveKey> out;
    for (const Plx_ListNode *n = list->head; n != nullptr; n = n->next)
        out.push_back(*static_cast<const MatchMoveKey *>(n->data));
    return out;
}

// The node's tail as the compositor expects it, built from its rule: boxes at +-h/30 and
// +-h/15 around centres at the thirds of the frame.
std::string expected_trailer()
{
    std::string t = "0, 0, Background.width, 0, 0, Background.height,\n"
                    "Background.width, Background.height, \"default\", xFilter, 0, 0.5, 0, 1, \"Over\",\n"
                    "0, \"v1.2\", 1, 20, \"1/16\", \"luminance\", 0.75, \"use start frame\",\n"
                    "0.5, \"stop\", 0,\n";
    const bool two_x[4] = {false, true, true, false}, two_y[4] = {false, false, true, true};
    for (int box = 0; box < 4; ++box) {
        t += "\"track" + std::to_string(box + 1) + "\",\n";
        std::string cx = std::string(two_x[box] ? "2*" : "") + "Background.width/3";
        std::string cy = std::string(two_y[box] ? "2*" : "") + "Background.height/3";
        for (const char *half : {"30", "15"}) {
            for (const std::string &c : {cx, cy}) {
                for (const char *sign : {"-", "+"}) {
                    bool indented = box == 0 && c == cx && std::string(sign) == "+" &&
                                    std::string(half) == "30";
                    t += (indented ? "    " : "") + c + sign + "Background.height/" + half + ",\n";
                }
            }
        }
    }
    t.replace(t.size() - 2, 2, ");\n");
    return t;
}

// Two keys on a 200 x 100 image.
void two_keys(KeyList &k)
{
    k.add(1, {10.5, 20, 110, 20.25, 10, 80, 110.125, 80});
    k.add(2, {11.5, 21, 111, 21.25, 11, 81, 111.125, 81});
}

TEST(MatchMoveScript, WriterTextIsExact)
{
    KeyList k;
    two_keys(k);
    std::string path = temp_path("exact.shk");
    ASSERT_TRUE(bWriteShakeMatchMoveFile(path.c_str(), 100, 200, "Corners", k.list, 1.0));
    std::string expected = "# This corresponds to file numbers 1-2 in the original clip\n"
                           "# Image dimensions 200x100\n"
                           "Corners = MatchMove(0, 0, 1, \"4 point\",\n"
                           "   Linear(0,10.500000@1,11.500000@2),\n"
                           "   Linear(0,80.000000@1,79.000000@2), 1, 1,\n"
                           "   Linear(0,110.000000@1,111.000000@2),\n"
                           "   Linear(0,79.750000@1,78.750000@2), 1, 1,\n"
                           "   Linear(0,10.000000@1,11.000000@2),\n"
                           "   Linear(0,20.000000@1,19.000000@2),\n"
                           "   Linear(0,110.125000@1,111.125000@2),\n"
                           "   Linear(0,20.000000@1,19.000000@2),\n" +
                           expected_trailer();
    EXPECT_EQ(slurp(path), expected);

    // Scale multiplies positions and dimensions (truncated to integers).
    ASSERT_TRUE(bWriteShakeMatchMoveFile(path.c_str(), 100, 201, "Corners", k.list, 1.5));
    std::string scaled = slurp(path);
    EXPECT_NE(scaled.find("# Image dimensions 301x150\n"), std::string::npos);
    EXPECT_NE(scaled.find("   Linear(0,15.750000@1,17.250000@2),\n"), std::string::npos);
    EXPECT_NE(scaled.find("   Linear(0,120.000000@1,118.500000@2), 1, 1,\n"), std::string::npos);
}

TEST(MatchMoveScript, RoundTripKeepsSixDecimals)
{
    KeyList k;
    for (uint32_t f = 5; f < 12; ++f) {
        double t = f * 0.7318;
        k.add(f, {100 + 13.123456789 * t, 50 - 3.3333333 * t, 600.987654321 - t, 40 + t * t,
                  590 + std::sin(t) * 7, 380.5 + 1e-7 * f, 95.0000004, 400 - t / 3});
    }
    std::string path = temp_path("round.shk");
    ASSERT_TRUE(bWriteShakeMatchMoveFile(path.c_str(), 480, 720, "Screen_1", k.list, 1.0));

    int32_t height = 0, width = 0;
    char name[32] = "";
    Plx_List *read = nullptr;
    ASSERT_TRUE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, name, sizeof name, &read));
    EXPECT_EQ(height, 480);
    EXPECT_EQ(width, 720);
    EXPECT_STREQ(name, "Screen_1");
    std::vector<MatchMoveKey> a = keys_of(k.list), b = keys_of(read);
    ASSERT_EQ(a.size(), b.size());
    for (size_t i = 0; i < a.size(); ++i) {
        EXPECT_EQ(a[i].frame, b[i].frame);
        for (int c = 0; c < 4; ++c)
            for (int j = 0; j < 2; ++j)
                EXPECT_NEAR(a[i].corners[c][j], b[i].corners[c][j], 5.0001e-7) << i << " " << c << j;
    }
    plx_list_free(read, free);
}

TEST(MatchMoveScript, DimensionsLineIsOptional)
{
    KeyList k;
    two_keys(k);
    std::string path = temp_path("nodims.shk");
    ASSERT_TRUE(bWriteShakeMatchMoveFile(path.c_str(), 100, 200, "Corners", k.list, 1.0));
    std::string text = slurp(path);
    size_t line2 = text.find('\n') + 1;
    text.erase(line2, text.find('\n', line2) + 1 - line2);
    spit(path, text);

    // The caller's size stands in, and its height turns y back.
    int32_t height = 300, width = 400;
    Plx_List *read = nullptr;
    ASSERT_TRUE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, nullptr, 0, &read));
    EXPECT_EQ(height, 300);
    EXPECT_EQ(width, 400);
    std::vector<MatchMoveKey> b = keys_of(read);
    ASSERT_EQ(b.size(), 2u);
    EXPECT_DOUBLE_EQ(b[0].corners[0][1], 300 - 80.0);
    EXPECT_DOUBLE_EQ(b[1].corners[1][1], 300 - 78.75);
    plx_list_free(read, free);

    // Without a usable size of the caller's the script cannot be turned back: code 7.
    for (auto [h, w] : {std::pair{0, 400}, std::pair{300, 0}, std::pair{-5, -5}}) {
        height = h;
        width = w;
        read = nullptr;
        EXPECT_FALSE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, nullptr, 0, &read));
        EXPECT_EQ(origin_code(), 7);
        EXPECT_EQ(read, nullptr);
        EXPECT_EQ(height, h);
        EXPECT_EQ(width, w);
    }
}

TEST(MatchMoveScript, FramesRenumberedToHeader)
{
    std::string path = temp_path("renumber.shk");
    std::string text = "# This corresponds to file numbers 1-3 in the original clip\n"
                       "Plate = MatchMove(0, 0, 1, \"4 point\",\n"
                       "   Linear(0,1@100,2@101,3@102),\n"
                       "   Linear(0,10@100,20@101,30@102), 1, 1,\n";
    for (int i = 0; i < 6; ++i)
        text += "   Linear(0,4@100,5@101,6@102)" + std::string(i == 1 ? ", 1, 1,\n" : ",\n");
    text += "whatever follows is not read";
    spit(path, text);
    int32_t height = 50, width = 60;
    char name[6];
    Plx_List *read = nullptr;
    ASSERT_TRUE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, name, sizeof name, &read));
    EXPECT_STREQ(name, "Plate");
    std::vector<MatchMoveKey> b = keys_of(read);
    ASSERT_EQ(b.size(), 3u);
    for (uint32_t i = 0; i < 3; ++i) {
        EXPECT_EQ(b[i].frame, 1 + i);
        EXPECT_DOUBLE_EQ(b[i].corners[0][0], 1.0 + i);
        EXPECT_DOUBLE_EQ(b[i].corners[0][1], 50 - 10.0 * (i + 1));
        EXPECT_DOUBLE_EQ(b[i].corners[3][0], 4.0 + i);
        EXPECT_DOUBLE_EQ(b[i].corners[3][1], 50 - 4.0 - i);
    }
    plx_list_free(read, free);

    // Empty curves give an empty list.
    text = "# This corresponds to file numbers 0-0 in the original clip\n"
           "N = MatchMove(0, 0, 1, \"4 point\",\n";
    for (int i = 0; i < 8; ++i) text += std::string(" Linear(0)") + (i == 1 || i == 3 ? ", 1, 1,\n" : ",\n");
    spit(path, text);
    read = nullptr;
    ASSERT_TRUE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, nullptr, 0, &read));
    EXPECT_EQ(plx_list_get_size(read), 0u);
    plx_list_free(read, free);
}

TEST(MatchMoveScript, MalformedScriptsFailWith26)
{
    KeyList k;
    two_keys(k);
    std::string path = temp_path("good.shk");
    ASSERT_TRUE(bWriteShakeMatchMoveFile(path.c_str(), 100, 200, "Corners", k.list, 1.0));
    const std::string good = slurp(path);
    auto replaced = [&](const std::string &from, const std::string &to) {
        std::string s = good;
        size_t at = s.find(from);
        EXPECT_NE(at, std::string::npos) << from;
        return s.replace(at, from.size(), to);
    };
    const std::vector<std::pair<const char *, std::string>> cases = {
        {"empty file", ""},
        {"first header number missing", replaced("numbers 1-2", "numbers -2")},
        {"header words wrong", replaced("in the original clip", "in the first clip")},
        {"first file above last", replaced("numbers 1-2", "numbers 3-2")},
        {"first file negative", replaced("numbers 1-2", "numbers -1-2")},
        {"dimensions without x", replaced("200x100", "200 100")},
        {"node line", replaced(" = MatchMove(0, 0, 1,", " = MatchMoves(0, 0, 1,")},
        {"key separator missing", replaced("Linear(0,10.500000@1", "Linear(0 10.500000@1")},
        {"key without frame", replaced("10.500000@1,", "10.500000,")},
        {"number not a number", replaced("11.500000@2),\n", "x@2),\n")},
        {"later frame differs", replaced("80.000000@1,79.000000@2", "80.000000@1,79.000000@3")},
        {"later curve short", replaced("110.000000@1,111.000000@2", "110.000000@1")},
        {"later curve long", replaced("110.000000@1,111.000000@2", "110.000000@1,111.000000@2,1@3")},
        {"end marker not 1", replaced("79.750000@1,78.750000@2), 1, 1,", "79.750000@1,78.750000@2), 1, 2,")},
        {"end marker missing", replaced("79.750000@1,78.750000@2), 1, 1,", "79.750000@1,78.750000@2),")},
        {"truncated", good.substr(0, good.find("   Linear(0,110.125000"))},
    };
    for (const auto &[what, text] : cases) {
        spit(path, text);
        int32_t height = 7, width = 9;
        char name[16] = "keep";
        Plx_List *read = nullptr;
        EXPECT_FALSE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, name, sizeof name, &read)) << what;
        EXPECT_EQ(origin_code(), 26) << what;
        EXPECT_EQ(read, nullptr) << what;
        EXPECT_EQ(height, 7) << what;
        EXPECT_EQ(width, 9) << what;
        EXPECT_STREQ(name, "keep") << what;
    }
}

TEST(MatchMoveScript, FilesAndArguments)
{
    KeyList k;
    two_keys(k);
    int32_t height = 1, width = 1;
    Plx_List *read = nullptr;
    std::string missing = temp_path("does_not_exist.shk");
    std::remove(missing.c_str());
    EXPECT_FALSE(bReadShakeMatchMoveFile(missing.c_str(), &height, &width, nullptr, 0, &read));
    EXPECT_EQ(origin_code(), 25);

    std::string no_dir = temp_path("no_such_dir/out.shk");
    EXPECT_FALSE(bWriteShakeMatchMoveFile(no_dir.c_str(), 100, 200, "Corners", k.list, 1.0));
    EXPECT_EQ(origin_code(), 25);
    EXPECT_EQ(origin_function(), "pWriteShakeMatchMoveFile");

    // A name longer than the caller's buffer is refused, not overrun.
    std::string path = temp_path("name.shk");
    ASSERT_TRUE(bWriteShakeMatchMoveFile(path.c_str(), 100, 200, "ALongerNodeName", k.list, 1.0));
    char small[8] = "keep";
    EXPECT_FALSE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, small, sizeof small, &read));
    EXPECT_EQ(origin_code(), 7);
    EXPECT_STREQ(small, "keep");
    EXPECT_EQ(read, nullptr);

    // Arguments the writer refuses leave no file behind.
    std::string out = temp_path("refused.shk");
    std::remove(out.c_str());
    KeyList empty, unordered;
    unordered.add(3, {0, 0, 1, 0, 0, 1, 1, 1});
    unordered.add(3, {0, 0, 1, 0, 0, 1, 1, 1});
    KeyList not_finite;
    not_finite.add(1, {NAN, 0, 1, 0, 0, 1, 1, 1});
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 100, 200, "N", empty.list, 1.0));
    EXPECT_EQ(origin_code(), 24);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 100, 200, "N", unordered.list, 1.0));
    EXPECT_EQ(origin_code(), 7);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 100, 200, "N", not_finite.list, 1.0));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 100, 200, "two words", k.list, 1.0));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 100, 200, "", k.list, 1.0));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 0, 200, "N", k.list, 1.0));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 100, 200, "N", k.list, 0.0));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(out.c_str(), 100, 200, nullptr, k.list, 1.0));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(bWriteShakeMatchMoveFile(nullptr, 100, 200, "N", k.list, 1.0));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(fs::exists(out));
    EXPECT_FALSE(bReadShakeMatchMoveFile(path.c_str(), nullptr, &width, nullptr, 0, &read));
    EXPECT_EQ(origin_code(), 32);
    EXPECT_FALSE(bReadShakeMatchMoveFile(path.c_str(), &height, &width, nullptr, 0, nullptr));
    EXPECT_EQ(origin_code(), 32);
}

// A write that fails part-way (here past a file-size limit, in a child process) leaves the
// earlier script byte for byte and no file of its own; a device is written in place and kept;
// an endless device is refused at its first byte.
TEST(MatchMoveScript, FailedWritesKeepWhatWasThere)
{
    KeyList k, longer;
    two_keys(k);
    for (uint32_t f = 1; f <= 200; ++f) longer.add(f, {1, 2, 3, 4, 5, 6, 7, 8});
    std::string path = temp_path("kept.shk");
    ASSERT_TRUE(bWriteShakeMatchMoveFile(path.c_str(), 100, 200, "Corners", k.list, 1.0));
    const std::string before = slurp(path);
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        std::signal(SIGXFSZ, SIG_IGN);
        rlimit limit{512, 512};
        setrlimit(RLIMIT_FSIZE, &limit);
        bool failed = !bWriteShakeMatchMoveFile(path.c_str(), 100, 200, "Corners", longer.list, 1.0);
        _exit(failed && origin_code() == 36 ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "the write did not fail with 36";
    EXPECT_EQ(slurp(path), before);
    for (const auto &entry : fs::directory_iterator(fs::path(path).parent_path()))
        EXPECT_EQ(entry.path().filename().string().find("kept.shk.tmp"), std::string::npos) << entry.path();

    EXPECT_TRUE(bWriteShakeMatchMoveFile("/dev/null", 100, 200, "Corners", k.list, 1.0));
    EXPECT_TRUE(fs::is_character_file("/dev/null"));
    int32_t height = 100, width = 200;
    Plx_List *read = nullptr;
    EXPECT_FALSE(bReadShakeMatchMoveFile("/dev/zero", &height, &width, nullptr, 0, &read));
    EXPECT_EQ(origin_code(), 26);
}

}  // namespace
