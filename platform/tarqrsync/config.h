#pragma once

#include <string>
#include <vector>

namespace TARQ {
namespace Backup {

constexpr int kMaxPort = 65535;

/// /usr/tarq/etc/tarqrsync.conf, section "rsync". What the file does not say stays as it is here.
struct Config {
    int daemon_port = 873;
    std::string rsync = "rsync";
    std::string ssh = "ssh";
    std::vector<std::string> ssh_options;
    int answer_seconds = 60;  ///< for the log-in of a copy, and for a command
    int dead_seconds = 120;   ///< without any answer, after which a connection is given up
};

/// Reads the file, if there is one. Empty, or what is wrong with it, for a person.
std::string ReadConfig(Config* config);

}  // namespace Backup
}  // namespace TARQ
