// What an administrator sets in /usr/tarq/etc/zel_daemon.conf; docs/daemon-protocol.md has the
// keys.
#pragma once

#include <chrono>
#include <string>

#include "base/config_file.h"

namespace zel_daemon {

struct DaemonConfig {
    unsigned int workers = 2;                       ///< runs at the same time
    std::chrono::milliseconds debounce{1000};       ///< quiet time before changes are sent ...
    std::chrono::milliseconds debounce_max{10000};  ///< ... but they wait no longer than this
    std::chrono::seconds poll{900};  ///< how often what cannot be watched has a full resync
    std::chrono::milliseconds retry_first{10000};  ///< a run that failed is tried again after ...
    std::chrono::milliseconds retry_max{3600000};  ///< ... which doubles with each try, up to this
    /// Verification by itself reads so much in a second, on average over all tasks, ...
    unsigned int verify_rate = 16;                ///< in MiB
    unsigned int verify_files = 10000;            ///< ... in slices of so many files at most ...
    std::chrono::milliseconds verify_gap{10000};  ///< ... which begin at least so long apart
    std::string group;  ///< whose members may use the socket; empty: nobody's
};

/// Reads the file; keys that are missing, and all of them without a file, have their defaults.
/// Throws base::ConfigError for a value that does not pass, for a group that this machine does not
/// know, and for a section or key that nobody would read.
DaemonConfig ReadDaemonConfig();

}  // namespace zel_daemon
