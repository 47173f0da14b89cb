// Names of the motion models on the command line.
#include "commands.hpp"

namespace plano_tool {

namespace {
const std::pair<const char *, uint32_t> kModels[] = {
    {"translation", TRACK_MODEL_TRANSLATE},
    {"translation-scale", TRACK_MODEL_TRANS_SCALE},
    {"translation-rotation-scale", TRACK_MODEL_TRANS_ROT_SCALE},
    {"affine", TRACK_MODEL_AFFINE},
    {"perspective", TRACK_MODEL_PROJ},
};
}  // namespace

uint32_t model_from_name(const std::string &name)
{
    for (const auto &[text, model] : kModels)
        if (name == text) return model;
    throw ToolError("unknown motion model '" + name +
                    "' (translation, translation-scale, translation-rotation-scale, affine, perspective)");
}

std::string model_name(uint32_t model)
{
    for (const auto &[text, value] : kModels)
        if (model == value) return text;
    return "unknown";
}

}  // namespace plano_tool
