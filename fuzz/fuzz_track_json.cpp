// The tool's track JSON reader on arbitrary files. Bad input must come back as ToolError, the
// tool's one failure a user sees as a message; any other exception escaping is a finding, and
// so is a sanitizer report.
#include <cstdint>

#include "fuzz_input_file.hpp"
#include "track_io.hpp"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    static const plano_fuzz::InputFile file("fuzz_track_json");
    const std::string &path = file.write(data, size);
    try {
        plano_tool::read_json(path);
    } catch (const plano_tool::ToolError &) {
    }
    return 0;
}
