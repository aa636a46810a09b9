// The text of a server command: whatever is taken for one keeps the rules, and written down again
// means the same.
#include <cstdint>
#include <string>

#include "fuzz/require.h"
#include "programs/zel_server/command.h"
#include "programs/zel_server/names.h"

namespace {

std::string Line(const std::string& key, const std::string& value) {
    Require(value.find_first_of(std::string("\"\n\r\0", 4)) == std::string::npos);
    return key + "=\"" + value + "\"\n";
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    const auto command = zel_server::ParseCommand(text);
    if (!command) {
        return 0;
    }
    const auto session = zel_server::ParseSession(text);
    Require(session.has_value() && zel_server::IsClientId(command->client_id));
    std::string again = Line("session", *session) + Line("command", command->name) +
                        Line("clientID", command->client_id);
    for (const auto& [key, value] : command->params) {
        Require(key != "session" && key != "command" && key != "clientID");
        again += Line(key, value);
    }
    // The last line break may have been missing.
    Require(again.size() <= text.size() + 1);
    const auto parsed = zel_server::ParseCommand(again);
    Require(again.size() > 5 * 1024 || (parsed && parsed->params == command->params));
    return 0;
}
