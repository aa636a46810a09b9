// The configuration of the rsync daemon that serves the shares.
#pragma once

#include <string>

#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Writes rsyncd.conf, if it is not there already word for word: the daemon's own part, the command
/// module, and the folders of the shares' and the admin's modules. False, with errno set, on
/// failure.
bool WriteRsyncdConfig(const ServerConfig& config);

/// An exec line of the daemon, which a shell reads and then is. The root folder is named: the
/// daemon may have been started without.
std::string ExecLine(const ServerConfig& config, const char* operation);

/// Whether a path can stand in the daemon's configuration and in its exec lines.
bool IsPlainPath(const std::string& path);

}  // namespace zel_server
