// Where the rsync daemon listens, and running it.
#pragma once

#include <string>
#include <vector>

#include "programs/zel_server/port.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

/// The addresses that the daemon listens on; an empty one is all of them. One that was chosen has
/// the loopback address beside it: clients that come through ssh arrive there.
std::vector<std::string> ServedAddresses(const ServerConfig& config);

/// Whether the process is a daemon of this server.
bool IsOurDaemon(pid_t pid);

/// Whether daemons of this server listen on all addresses that are to be served. `listeners`: those
/// of the port.
bool ServesAll(const ServerConfig& config, const std::vector<Listener>& listeners);

/// `zel_server serve`: runs the rsync daemon in the foreground, two where two addresses are served
/// (stock rsync listens on one), until one has ended, which is a failure: it ends the other then.
void Serve();

}  // namespace zel_server
