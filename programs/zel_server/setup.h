// `zel_server setup`: creates or changes a server, and gets it running.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zel_server {

/// Empty values keep the current setting, or the default of a new server.
struct SetupOptions {
    std::string storage;               ///< required for a new server
    std::vector<std::string> volumes;  ///< NAME=FOLDER; NAME= alone removes the volume
    std::string address;               ///< "all": every address
    std::string user;
    std::string keep;                 ///< how long versions are kept, see ParseRetention()
    std::string keep_at_least;        ///< what is younger is not given up for space, see ParseAge()
    std::string certificate;          ///< PEM file with the admin's own key and certificate
    std::optional<uint64_t> reserve;  ///< percent of a disk, at most kMaxReserve
    int tls_port = 0;
    int plain_port = 0;
    std::optional<bool> plain;
    std::optional<bool> encryption;
    std::optional<bool> without_attributes;
};

/// Checks that all of it is possible, writes the configuration, and restarts the server with it, or
/// prints how to. Prints what it did.
void Setup(const SetupOptions& options);

}  // namespace zel_server
