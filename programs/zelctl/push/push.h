// Pushing shares to the server, from the first probe to the last word.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "programs/zelctl/server/connection.h"

namespace zelctl {

struct PushOptions {
    ConnectionOptions connection;
    std::optional<ZEL::SyncInfo> info;  ///< used in place of `connection` when it is there
    std::vector<std::string> shares;
    std::string path = "/";  ///< what of each share; "/" is all
    std::vector<std::string> excludes;
    unsigned int bandwidth_limit = 0;  ///< KiB a second; 0: none
    bool dry_run = false;
    bool quiet = false;
};

/// Finds the server, pairs when needed, and pushes share after share. Stops at the first that
/// fails.
void Push(const PushOptions& options);

/// Asks whether the server would take these shares from this client. Changes nothing.
void CheckPairing(const ConnectionOptions& connection, const std::vector<std::string>& shares);

}  // namespace zelctl
