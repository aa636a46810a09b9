// The host keys of ssh servers that stand in the file of servers, by the servers' names: lines of a
// known_hosts file, which ssh reads (and, for servers that do not stand there, writes).
#pragma once

#include <optional>
#include <string>

namespace TARQ {
namespace Backup {

/// "ssh-ed25519 AAAA..." of the first line that names `name` alone; none when there is none. Throws
/// ServersError.
std::optional<std::string> ReadKnownHost(const std::string& path, const std::string& name);

/// Puts a line of `name` with `key` in the place of all that name it alone; without a key they go.
/// Throws ServersError.
void WriteKnownHost(const std::string& path, const std::string& name,
                    const std::optional<std::string>& key);

}  // namespace Backup
}  // namespace TARQ
