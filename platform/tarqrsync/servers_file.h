// The text of the file of servers (tarq/rsync_servers.h).
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

/// One section of the file.
struct ServerSection {
    std::string section;  ///< its name, letter by letter
    RsyncServer server;
};

/// All sections of `text`. Every line counts: throws ServersError, which begins with `path` and the
/// line's number, for the first that says nothing, or nothing that is known, so that a server whose
/// section is damaged is never taken for one that nobody has named.
std::vector<ServerSection> ParseServers(std::string_view text, const std::string& path);

/// Why the server cannot stand in the file; empty when it can.
std::string FaultOf(const RsyncServer& server);

}  // namespace Backup
}  // namespace TARQ
