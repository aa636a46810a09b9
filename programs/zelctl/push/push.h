// Pushes shares to the server, from finding it to the final report.
#pragma once

#include <string>
#include <vector>

#include "programs/zelctl/server/connection.h"

namespace zelctl {

struct PushOptions {
    ConnectionOptions connection;
    std::vector<std::string> shares;
    std::string path = "/";  ///< what of each share; "/" is all
    std::vector<std::string> excludes;
    bool dry_run = false;
    bool confirmed = false;  ///< lose what has to be lost, without asking
    bool quiet = false;
};

/// Finds the server, pairs if necessary, and pushes one share after the other. Throws Failure.
void Push(const PushOptions& options);

/// Asks whether the server would accept these shares from this client. Changes nothing.
void CheckPairing(const ConnectionOptions& connection, const std::vector<std::string>& shares);

}  // namespace zelctl
