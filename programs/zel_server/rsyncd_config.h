// The configuration of the rsync daemon that serves the shares.
#pragma once

#include <string>

#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Set in the environment of each rsync daemon: the number of its process, which is RSYNC_PID to
/// what that runs.
inline constexpr const char* kConnectionVariable = "ZEL_CONNECTION";

/// Writes rsyncd.conf unless it is up to date: the global part, the module of commands and that of
/// pushes in one connection. Each connection's daemon gets it with the modules that are open then
/// (connection_config.h). False, with errno set, on failure.
bool WriteRsyncdConfig(const ServerConfig& config);

/// What each module that leads to a copy has in common: who asks whether a run is taken, and how a
/// copy keeps what it gets. `keeps_attributes`: its disk does (KeepsAttributes()).
std::string LinesOfCopy(const ServerConfig& config, bool keeps_attributes);

/// An exec line for the daemon's configuration; the shell that reads it is replaced by the program.
/// It names the root folder, as the daemon may have been started without that in its environment.
std::string ExecLine(const ServerConfig& config, const char* operation);

/// Whether a path can be written in the daemon's configuration and in its exec lines.
bool IsPlainPath(const std::string& path);

}  // namespace zel_server
