// The keys that servers show, and where the ones that ssh trusts are kept.
#pragma once

#include <string>

namespace TARQ {
namespace Backup {

/// Of ssh's own making for servers that do not stand in the file of servers; a line of ours for
/// each that does, see known_hosts.h.
constexpr char kKnownHostsPath[] = "/usr/tarq/etc/tarqrsync_known_hosts";

/// "SHA256:..." of "ssh-ed25519 AAAA...". Throws ServersError for what is no key.
std::string FingerprintOfHostKey(const std::string& key);

}  // namespace Backup
}  // namespace TARQ
