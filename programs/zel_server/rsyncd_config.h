// The configuration of the rsync daemon that serves the shares.
#pragma once

#include <string>

#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Writes rsyncd.conf: the daemon's own part, the command module, and the folders of the shares'
/// and the admin's modules. False, with errno set, on failure.
bool WriteRsyncdConfig(const ServerConfig& config);

/// Makes a share's folder, if it is not there yet, for the user that owns the copies.
bool MakeShareFolder(const ServerConfig& config, const std::string& path);

/// Writes the module of one share, if it is not there already word for word. The daemon knows it
/// from the next connection on.
bool WriteShareModule(const ServerConfig& config, const std::string& share,
                      const std::string& module, const std::string& path);

/// The command that starts the daemon, for a person to type.
std::string StartCommand();

/// Whether a path can stand in the daemon's configuration and in its exec lines.
bool IsPlainPath(const std::string& path);

}  // namespace zel_server
