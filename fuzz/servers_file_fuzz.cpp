// The file of servers, as a person or a failing disk may have left it.
#include <cstddef>
#include <cstdint>
#include <set>
#include <string>

#include "fuzz/require.h"
#include "platform/tarqrsync/servers_file.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    using namespace TARQ::Backup;
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    try {
        std::set<std::string> names;
        for (const ServerSection& section : ParseServers(text, "file")) {
            // Whatever is let through can be put in an argument list, and is there once.
            Require(FaultOf(section.server).empty());
            Require(section.server.host == ServerName(section.section));
            Require(names.insert(section.server.host).second);
        }
    } catch (const ServersError& error) {
        for (const char* c = error.what(); *c != '\0'; ++c) {
            Require(*c >= ' ' && *c <= '~');
        }
    }
    return 0;
}
