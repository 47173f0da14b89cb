// JSON, CSV and script files of tracking results.
#include "track_io.hpp"

#include <cmath>
#include <cstdio>
#include <filesystem>
#include <sstream>
#include <nlohmann/json.hpp>

#include "files.hpp"
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
    case kStatusUnreadable: return "unreadable";
    default: return "status " + std::to_string(status);
    }
}

namespace {

// A number of a JSON file that must be finite, and an integer within [lo, hi] when asked.
double number_from(const json &j, const std::string &what)
{
    if (!j.is_number()) throw ToolError(what + " is not a number");
    double v = j.get<double>();
    if (!std::isfinite(v)) throw ToolError(what + " is not finite");
    return v;
}

int64_t integer_from(const json &j, const std::string &what, int64_t lo, int64_t hi)
{
    if (!j.is_number_integer()) throw ToolError(what + " is not a whole number");
    // Unsigned values above the signed range would wrap in the signed read.
    if (j.is_number_unsigned() && j.get<uint64_t>() > static_cast<uint64_t>(hi))
        throw ToolError(what + " is out of range");
    int64_t v = j.get<int64_t>();
    if (v < lo || v > hi) throw ToolError(what + " " + std::to_string(v) + " is out of range");
    return v;
}

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
        const std::string name = what + " corner " + std::to_string(i + 1);
        q[i] = {number_from(p[0], name), number_from(p[1], name)};
    }
    return q;
}

}  // namespace

nlohmann::ordered_json matrix_json(const Plx_Matrix33 &H)
{
    nlohmann::ordered_json rows = nlohmann::ordered_json::array();
    for (const auto &row : H.m) rows.push_back({row[0], row[1], row[2]});
    return rows;
}

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
        jf["homography"] = matrix_json(f.homography);
        jf["corners"] = quad_json(f.corners);
        // JSON has no infinities: an unknown residual is null.
        jf["rms_residual"] = std::isfinite(f.rms_residual) ? json(f.rms_residual) : json(nullptr);
        // JSON has no NaN or infinity either: information with one is not known.
        bool finite = true;
        for (const auto &row : f.information)
            for (double v : row) finite = finite && std::isfinite(v);
        jf["information"] = f.information.empty() || !finite ? json(nullptr) : json(f.information);
        if (f.true_corners) jf["true_corners"] = quad_json(*f.true_corners);
        if (!f.reason.empty()) jf["reason"] = f.reason;
        frames.push_back(jf);
    }
    j["frames"] = frames;
    write_text_atomically(path, j.dump(2) + '\n');
}

TrackResult read_json(const std::string &path)
{
    std::string text = read_text_file(path, kMaxTextBytes);
    TrackResult r;
    try {
        json j = json::parse(text);
        if (!j.is_object()) throw ToolError("not a JSON object");
        r.sequence = j.value("sequence", "");
        r.width = static_cast<int32_t>(integer_from(j.at("width"), "width", 1, INT32_MAX));
        r.height = static_cast<int32_t>(integer_from(j.at("height"), "height", 1, INT32_MAX));
        if (int64_t{r.width} * r.height > kMaxImagePixels) throw ToolError("image size is too large");
        if (j.contains("reference_frame"))
            r.reference_frame = static_cast<int>(integer_from(j["reference_frame"], "reference_frame", INT32_MIN, INT32_MAX));
        r.model = j.value("model", "");
        if (j.contains("reference_quad")) r.reference_quad = quad_from(j["reference_quad"], "reference_quad");
        r.complete = j.value("complete", true);
        r.stopped = j.value("stopped", "");
        const json &frames = j.at("frames");
        if (!frames.is_array()) throw ToolError("frames is not a list");
        for (const json &jf : frames) {
            FrameResult f;
            f.frame = static_cast<int>(integer_from(jf.at("frame"), "frame", INT32_MIN, INT32_MAX));
            const std::string at = "frame " + std::to_string(f.frame);
            if (!r.frames.empty() && f.frame <= r.frames.back().frame)
                throw ToolError(at + " is out of order or listed twice");
            f.status = jf.contains("status_code")
                           ? static_cast<uint32_t>(integer_from(jf["status_code"], at + " status_code", 0, UINT32_MAX))
                           : 0u;
            const json &h = jf.at("homography");
            if (!h.is_array() || h.size() != 3) throw ToolError(at + " homography is not 3x3");
            for (int i = 0; i < 3; ++i) {
                if (!h[i].is_array() || h[i].size() != 3) throw ToolError(at + " homography is not 3x3");
                for (int k = 0; k < 3; ++k) f.homography.m[i][k] = number_from(h[i][k], at + " homography");
            }
            f.corners = quad_from(jf.at("corners"), at + " corners");
            // Null (or absent) stands for a residual or information that is not known.
            f.rms_residual = INFINITY;
            if (jf.contains("rms_residual") && !jf["rms_residual"].is_null()) {
                f.rms_residual = number_from(jf["rms_residual"], at + " rms_residual");
                if (f.rms_residual < 0) throw ToolError(at + " rms_residual is negative");
            }
            if (jf.contains("information") && !jf["information"].is_null()) {
                const json &info = jf["information"];
                if (!info.is_array() || info.size() > 16) throw ToolError(at + " information is not a square matrix");
                for (const json &row : info) {
                    if (!row.is_array() || row.size() != info.size())
                        throw ToolError(at + " information is not a square matrix");
                    f.information.emplace_back();
                    for (const json &v : row) f.information.back().push_back(number_from(v, at + " information"));
                }
            }
            if (jf.contains("true_corners")) f.true_corners = quad_from(jf["true_corners"], at + " true_corners");
            if (jf.contains("reason") && jf["reason"].is_string()) f.reason = jf["reason"].get<std::string>();
            r.frames.push_back(f);
        }
    } catch (const json::exception &e) {
        throw ToolError("'" + path + "' is not a tracking result: " + one_line(e.what()));
    } catch (const ToolError &e) {
        throw ToolError("'" + path + "' is not a tracking result: " + e.what());
    }
    return r;
}

void write_csv(const std::string &path, const TrackResult &r)
{
    std::ostringstream out;
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
    write_text_atomically(path, out.str());
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
    write_atomically(path, [&](const std::string &temporary) {
        check(bWriteShakeMatchMoveFile(temporary.c_str(), r.height, r.width, node_name.c_str(), keys, 1.0),
              "cannot write '" + path + "'");
    });
}

std::map<int, Quad> read_script(const std::string &path, int32_t width, int32_t height)
{
    check_input_file(path, kMaxScriptBytes);
    Plx_List *keys = nullptr;
    char name[256];
    check(bReadShakeMatchMoveFile(path.c_str(), &height, &width, name, sizeof name, &keys),
          "cannot read '" + path + "'");
    struct ListGuard {
        Plx_List *list;
        ~ListGuard() { plx_list_free(list, free); }
    } guard{keys};
    // The reader takes what its format allows; the tool takes only what a writer would write.
    auto refuse = [&](const std::string &why) -> void { throw ToolError("'" + path + "' " + why); };
    if (width < 1 || height < 1) refuse("has image dimensions " + std::to_string(width) + "x" + std::to_string(height));
    if (keys->size == 0) refuse("has no keys");
    std::map<int, Quad> out;
    for (const Plx_ListNode *n = keys->head; n != nullptr; n = n->next) {
        const auto *key = static_cast<const MatchMoveKey *>(n->data);
        if (key->frame > static_cast<uint32_t>(INT32_MAX)) refuse("has frame " + std::to_string(key->frame) + ", out of range");
        int frame = static_cast<int>(key->frame);
        if (!out.empty() && frame <= out.rbegin()->first)
            refuse("has frame " + std::to_string(frame) + " out of order or twice");
        Quad q;
        for (int i = 0; i < 4; ++i) {
            q[i] = {key->corners[i][0], key->corners[i][1]};
            if (!std::isfinite(q[i].x) || !std::isfinite(q[i].y))
                refuse("has a corner that is not a finite number at frame " + std::to_string(frame));
        }
        out[frame] = q;
    }
    return out;
}

}  // namespace plano_tool
