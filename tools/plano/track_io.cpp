// JSON, CSV and script files of tracking results.
#include "track_io.hpp"

#include <cmath>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>

#include "plano/matchmove.h"

namespace plano_tool {

using nlohmann::json;

std::string status_name(uint32_t status)
{
    switch (status) {
    case TRACK_REGION_OK: return "ok";
    case TRACK_REGION_LOST: return "lost";
    case TRACK_REGION_NO_MATCH: return "no match";
    case TRACK_REGION_PYRAMID_FAILED: return "pyramid failed";
    case TRACK_REGION_TOO_FEW_PIXELS: return "too few pixels";
    case TRACK_REGION_OUT_OF_VIEW: return "out of view";
    default: return "status " + std::to_string(status);
    }
}

namespace {

nlohmann::ordered_json quad_json(const Quad &q)
{
    nlohmann::ordered_json a = nlohmann::ordered_json::array();
    for (const Point &p : q) a.push_back({p.x, p.y});
    return a;
}

Quad quad_from(const json &j, const std::string &what)
{
    if (!j.is_array() || j.size() != 4) throw ToolError(what + " is not four corners");
    Quad q;
    for (int i = 0; i < 4; ++i) {
        const json &p = j[i];
        if (!p.is_array() || p.size() != 2 || !p[0].is_number() || !p[1].is_number())
            throw ToolError(what + " corner " + std::to_string(i + 1) + " is not [x, y]");
        q[i] = {p[0].get<double>(), p[1].get<double>()};
    }
    return q;
}

// Opens for writing, making the folders on the way.
std::ofstream open_out(const std::string &path)
{
    std::filesystem::path parent = std::filesystem::path(path).parent_path();
    std::error_code ec;
    if (!parent.empty()) std::filesystem::create_directories(parent, ec);
    std::ofstream out(path);
    if (!out) throw ToolError("cannot write '" + path + "'");
    return out;
}

void finish(std::ofstream &out, const std::string &path)
{
    out.close();
    if (!out) throw ToolError("cannot write '" + path + "' (disk full?)");
}

}  // namespace

void write_json(const std::string &path, const TrackResult &r)
{
    // Keys in the order written, for people reading the file.
    using json = nlohmann::ordered_json;
    json j;
    j["sequence"] = r.sequence;
    j["width"] = r.width;
    j["height"] = r.height;
    j["reference_frame"] = r.reference_frame;
    j["model"] = r.model;
    j["reference_quad"] = quad_json(r.reference_quad);
    j["complete"] = r.complete;
    if (!r.complete) j["stopped"] = r.stopped;
    json frames = json::array();
    for (const FrameResult &f : r.frames) {
        json jf;
        jf["frame"] = f.frame;
        jf["status"] = status_name(f.status);
        jf["status_code"] = f.status;
        json h = json::array();
        for (const auto &row : f.homography.m) h.push_back({row[0], row[1], row[2]});
        jf["homography"] = h;
        jf["corners"] = quad_json(f.corners);
        // JSON has no infinities: an unknown residual is null.
        jf["rms_residual"] = std::isfinite(f.rms_residual) ? json(f.rms_residual) : json(nullptr);
        jf["information"] = f.information.empty() ? json(nullptr) : json(f.information);
        if (f.true_corners) jf["true_corners"] = quad_json(*f.true_corners);
        frames.push_back(jf);
    }
    j["frames"] = frames;
    std::ofstream out = open_out(path);
    out << j.dump(2) << '\n';
    finish(out, path);
}

TrackResult read_json(const std::string &path)
{
    std::ifstream in(path);
    if (!in) throw ToolError("cannot read '" + path + "': no such file");
    TrackResult r;
    try {
        json j = json::parse(in);
        r.sequence = j.value("sequence", "");
        r.width = j.at("width").get<int32_t>();
        r.height = j.at("height").get<int32_t>();
        r.reference_frame = j.value("reference_frame", 0);
        r.model = j.value("model", "");
        if (j.contains("reference_quad")) r.reference_quad = quad_from(j["reference_quad"], "reference_quad");
        r.complete = j.value("complete", true);
        r.stopped = j.value("stopped", "");
        for (const json &jf : j.at("frames")) {
            FrameResult f;
            f.frame = jf.at("frame").get<int>();
            f.status = jf.value("status_code", 0u);
            const json &h = jf.at("homography");
            if (!h.is_array() || h.size() != 3) throw ToolError("homography is not 3x3");
            for (int i = 0; i < 3; ++i) {
                if (!h[i].is_array() || h[i].size() != 3) throw ToolError("homography is not 3x3");
                for (int k = 0; k < 3; ++k) f.homography.m[i][k] = h[i][k].get<double>();
            }
            f.corners = quad_from(jf.at("corners"), "corners");
            f.rms_residual = jf.contains("rms_residual") && jf["rms_residual"].is_number()
                                 ? jf["rms_residual"].get<double>()
                                 : INFINITY;
            if (jf.contains("information") && jf["information"].is_array())
                f.information = jf["information"].get<std::vector<std::vector<double>>>();
            if (jf.contains("true_corners")) f.true_corners = quad_from(jf["true_corners"], "true_corners");
            r.frames.push_back(f);
        }
    } catch (const json::exception &e) {
        throw ToolError("'" + path + "' is not a tracking result: " + e.what());
    } catch (const ToolError &e) {
        throw ToolError("'" + path + "' is not a tracking result: " + e.what());
    }
    if (r.width < 1 || r.height < 1) throw ToolError("'" + path + "' has no image size");
    return r;
}

void write_csv(const std::string &path, const TrackResult &r)
{
    std::ofstream out = open_out(path);
    out << "frame,status,rms_residual,x1,y1,x2,y2,x3,y3,x4,y4,h00,h01,h02,h10,h11,h12,h20,h21,h22\n";
    char buffer[64];
    for (const FrameResult &f : r.frames) {
        out << f.frame << ',' << status_name(f.status) << ',';
        if (std::isfinite(f.rms_residual)) {
            std::snprintf(buffer, sizeof buffer, "%.9g", f.rms_residual);
            out << buffer;
        }
        for (const Point &p : f.corners) {
            std::snprintf(buffer, sizeof buffer, ",%.9g,%.9g", p.x, p.y);
            out << buffer;
        }
        for (const auto &row : f.homography.m)
            for (double v : row) {
                std::snprintf(buffer, sizeof buffer, ",%.17g", v);
                out << buffer;
            }
        out << '\n';
    }
    finish(out, path);
}

void write_script(const std::string &path, const TrackResult &r, const std::string &node_name)
{
    Plx_List *keys = plx_list_new();
    if (keys == nullptr) throw ToolError("out of memory");
    struct ListGuard {
        Plx_List *list;
        ~ListGuard() { plx_list_free(list, free); }
    } guard{keys};
    for (const FrameResult &f : r.frames) {
        if (f.status != TRACK_REGION_OK || f.frame < 0) continue;
        auto *key = static_cast<MatchMoveKey *>(std::malloc(sizeof(MatchMoveKey)));
        if (key == nullptr) throw ToolError("out of memory");
        key->frame = static_cast<uint32_t>(f.frame);
        for (int i = 0; i < 4; ++i) {
            key->corners[i][0] = f.corners[i].x;
            key->corners[i][1] = f.corners[i].y;
        }
        if (!plx_list_insert_last(keys, key)) {
            std::free(key);
            throw ToolError("out of memory");
        }
    }
    if (keys->size == 0) throw ToolError("no tracked frame to write to '" + path + "'");
    check(bWriteShakeMatchMoveFile(path.c_str(), r.height, r.width, node_name.c_str(), keys, 1.0),
          "cannot write '" + path + "'");
}

std::map<int, Quad> read_script(const std::string &path, int32_t width, int32_t height)
{
    Plx_List *keys = nullptr;
    char name[256];
    check(bReadShakeMatchMoveFile(path.c_str(), &height, &width, name, sizeof name, &keys),
          "cannot read '" + path + "'");
    std::map<int, Quad> out;
    for (const Plx_ListNode *n = keys->head; n != nullptr; n = n->next) {
        const auto *key = static_cast<const MatchMoveKey *>(n->data);
        Quad q;
        for (int i = 0; i < 4; ++i) q[i] = {key->corners[i][0], key->corners[i][1]};
        out[static_cast<int>(key->frame)] = q;
    }
    plx_list_free(keys, free);
    return out;
}

}  // namespace plano_tool
