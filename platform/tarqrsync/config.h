#pragma once

#include <string>
#include <vector>

namespace TARQ {
namespace Backup {

/// /usr/tarq/etc/tarqrsync.conf, section "rsync". What the file does not say stays as it is here.
struct Config {
    int daemon_port = 873;
    std::string rsync = "rsync";
    std::string ssh = "ssh";
    std::vector<std::string> ssh_options;
};

/// Reads the file, if there is one. Empty, or what is wrong with it, for a person.
std::string ReadConfig(Config* config);

}  // namespace Backup
}  // namespace TARQ
