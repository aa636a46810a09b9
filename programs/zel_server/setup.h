// `zel_server setup`: from nothing to a server that runs.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace zel_server {

/// What is empty stays as it was, or is as usual at a new server.
struct SetupOptions {
    std::string storage;               ///< a new server needs it
    std::vector<std::string> volumes;  ///< NAME=FOLDER; NAME= alone takes the volume out
    std::string address;               ///< "all": everywhere
    std::string user;
    int port = 0;
    std::optional<bool> encryption;
};

/// Looks whether everything can be had, writes the configuration, and sees to it that the rsync
/// daemon runs with it, or says how to. Says what it did.
void Setup(const SetupOptions& options);

}  // namespace zel_server
