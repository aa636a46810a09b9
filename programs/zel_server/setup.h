// `zel_server setup`: from nothing to a server that runs.
#pragma once

#include <string>
#include <vector>

namespace zel_server {

struct SetupOptions {
    std::string storage;
    std::vector<std::string> volumes;  // NAME=FOLDER
    std::string address;
    std::string user;
    int port = 0;  ///< 0: the usual one
    bool no_encryption = false;
};

/// Looks whether everything can be had, writes the configuration, and sees to it that the rsync
/// daemon runs with it, or says how to. Says what it did; gives an exit code.
int Setup(const SetupOptions& options);

}  // namespace zel_server
