// plano stabilise end to end: a shaky shot made from a photograph under a smooth camera path
// plus known jitter, tracked and stabilised, must follow the smooth path.
#if defined(PLANO_TOOL_PATH)

#include <cmath>

#include "plano/plano.h"
#include "tool_test_util.hpp"

namespace {

using namespace tool_test;
using nlohmann::json;

using M3 = Plx_Matrix33;

M3 mul(const M3 &a, const M3 &b)
{
    M3 c;
    plx_mat33_rmultm33_s(&a, &b, &c);
    return c;
}

M3 invert(const M3 &a)
{
    M3 inverse{};
    EXPECT_TRUE(plx_mat33_invert_s(&a, &inverse));
    return inverse;
}

std::array<double, 2> apply(const M3 &h, double x, double y)
{
    double w = h.m[2][0] * x + h.m[2][1] * y + h.m[2][2];
    return {(h.m[0][0] * x + h.m[0][1] * y + h.m[0][2]) / w, (h.m[1][0] * x + h.m[1][1] * y + h.m[1][2]) / w};
}

// Rotation by angle (radians) about (cx, cy), then translation by (tx, ty).
M3 motion(double angle, double tx, double ty, double cx, double cy)
{
    double c = std::cos(angle), s = std::sin(angle);
    return {{{c, -s, cx - c * cx + s * cy + tx}, {s, c, cy - s * cx - c * cy + ty}, {0, 0, 1}}};
}

constexpr int kWidth = 320, kHeight = 200, kFrames = 17;

// Plate positions of frame f (from 1) to photograph positions. The smooth camera moves by a
// constant step every frame; jitter is added except at frames 1, 9 and 17, the anchors.
M3 camera(int f, bool jitter, double photo_width, double photo_height)
{
    const double cx = kWidth / 2.0, cy = kHeight / 2.0;
    M3 path = motion(0, photo_width / 2 - cx, photo_height / 2 - cy, 0, 0);
    const M3 step_back = motion(-0.3 * M_PI / 180, -2.0, -1.0, cx, cy);
    for (int i = 1; i < f; ++i) path = mul(path, step_back);
    if (!jitter || (f - 1) % 8 == 0) return path;
    return mul(path, motion(0.4 * M_PI / 180 * std::sin(1.1 * f), 3 * std::sin(1.7 * f), 2 * std::cos(2.3 * f), cx, cy));
}

TEST(ToolStabilise, ShakyShotFollowsItsSmoothPath)
{
    fs::path dir = test_dir();
    Pixels photo = read_pixels(fs::path(PLANO_DATA_DIR) / "coffee.png");
    ASSERT_GT(photo.width, 0);
    auto sample = [&](double x, double y, int c) {
        x -= 0.5;
        y -= 0.5;
        int x0 = int(std::floor(x)), y0 = int(std::floor(y));
        double fx = x - x0, fy = y - y0;
        auto at = [&](int xx, int yy) {
            return double(photo.at(std::clamp(xx, 0, photo.width - 1), std::clamp(yy, 0, photo.height - 1), c));
        };
        return (1 - fy) * ((1 - fx) * at(x0, y0) + fx * at(x0 + 1, y0)) + fy * ((1 - fx) * at(x0, y0 + 1) + fx * at(x0 + 1, y0 + 1));
    };
    for (int f = 1; f <= kFrames; ++f) {
        const M3 P = camera(f, true, photo.width, photo.height);
        Pixels plate = flat(kWidth, kHeight, {0, 0, 0});
        for (int r = 0; r < kHeight; ++r)
            for (int c = 0; c < kWidth; ++c) {
                auto p = apply(P, c + 0.5, r + 0.5);
                for (int k = 0; k < 3; ++k) plate.data[(size_t(r) * kWidth + c) * 3 + k] = float(sample(p[0], p[1], k));
            }
        char name[64];
        std::snprintf(name, sizeof name, "shaky/plate.%04d.png", f);
        write_pixels(dir / name, plate, OIIO::TypeDesc::UINT8);
    }
    ToolRun r = run_tool(dir, {"track", "-s", "shaky/plate.%04d.png", "--quad", "60,40,260,40,260,160,60,160", "-o",
                               "track.json", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    r = run_tool(dir, {"stabilise", "-t", "track.json", "--every", "8", "--json", "stab.json", "-o",
                       "stable/%04d.png", "--crop", "crop", "-q"});
    ASSERT_EQ(r.code, 0) << r.err;
    json stab = json::parse(slurp(dir / "stab.json"));
    EXPECT_EQ(stab["anchors"], json({1, 9, 17}));
    const double box_x = stab["box"][0].get<double>(), box_y = stab["box"][1].get<double>();
    ASSERT_EQ(stab["frames"].size(), size_t(kFrames));

    // Scene points of the tracked region: where the smooth camera sees them, and where the
    // stabilised frame puts them (through the plate of the shaky camera).
    double worst = 0;
    for (int f = 1; f <= kFrames; ++f) {
        M3 F;
        for (int i = 0; i < 3; ++i)
            for (int k = 0; k < 3; ++k) F.m[i][k] = stab["frames"][f - 1]["stabilise"][i][k].get<double>();
        const M3 shaky = camera(f, true, photo.width, photo.height), smooth = camera(f, false, photo.width, photo.height);
        for (auto [u, v] : {std::pair{80.0, 60.0}, std::pair{240.0, 60.0}, std::pair{160.0, 100.0}, std::pair{90.0, 150.0}}) {
            auto X = apply(camera(1, false, photo.width, photo.height), u, v);
            auto in_plate = apply(invert(shaky), X[0], X[1]);
            auto expected = apply(invert(smooth), X[0], X[1]);
            auto stabilised = apply(F, in_plate[0], in_plate[1]);
            worst = std::max(worst, std::hypot(stabilised[0] - (expected[0] - box_x), stabilised[1] - (expected[1] - box_y)));
        }
    }
    EXPECT_LT(worst, 0.1) << "px from the smooth path";
    Pixels first = read_pixels(dir / "stable/0001.png");
    EXPECT_EQ(first.width, stab["width"].get<int>());
    EXPECT_LT(first.width, kWidth);
    EXPECT_EQ(count_files(dir / "stable"), size_t(kFrames));
}

}  // namespace

#endif  // PLANO_TOOL_PATH
