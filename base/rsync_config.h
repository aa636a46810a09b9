#pragma once

#include <string>
#include <vector>

namespace base {

/// The port of the rsync daemon.
constexpr int kRsyncPort = 873;
/// The port on which it is reached through TLS.
constexpr int kRsyncTlsPort = 874;
constexpr int kMaxPort = 65535;

/// How rsync and ssh are run: this file, section "rsync".
constexpr char kRsyncConfigPath[] = "/usr/tarq/etc/tarqrsync.conf";

/// The defaults hold for what the file does not set.
struct RsyncConfig {
    int daemon_port = kRsyncPort;
    std::string rsync = "rsync";
    std::string ssh = "ssh";
    std::vector<std::string> ssh_options;
    int answer_seconds = 60;  ///< for the log-in of a copy, and for a command
    int dead_seconds = 120;   ///< without any answer, after which a connection is given up
};

/// Reads the file, if there is one, at `path`: kRsyncConfigPath, below the root folder. Throws
/// ConfigError.
RsyncConfig ReadRsyncConfig(const std::string& path);

}  // namespace base
