#pragma once

#include <string>

#include "base/rsync_config.h"
#include "platform/tarqrsync/settings.h"
#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

/// The way to the server.
enum class Transport {
    DAEMON,             ///< straight to the rsync daemon
    DAEMON_OVER_TLS,    ///< to a TLS proxy in front of the same daemon
    DAEMON_OVER_SSH,    ///< to the same daemon, through a connection that ssh forwards
    DIRECTORY_OVER_SSH  ///< to an rsync that ssh starts: a directory, no module
};

/// How one run reaches its server.
struct Route {
    std::string name;  ///< the server, as people know it
    Transport transport = Transport::DAEMON;
    int port = 0;             ///< that is connected to
    std::string fingerprint;  ///< of the key that a TLS server must have
    bool is_known = false;    ///< it stands in the file of servers: ssh takes no host key but the
                              ///< one that is kept for its name
};

/// As the file of servers says; for a server that does not stand there, as the settings do. A
/// module that begins with "/" is a directory and always reached over ssh; a command always goes to
/// the daemon. Throws ServersError.
Route RouteOf(const Settings& settings, const RunOptions& options, const base::RsyncConfig& config);

}  // namespace Backup
}  // namespace TARQ
