// Takes a machine that was lost back: its configuration and its files, from the server.
#pragma once

#include <string>

#include "programs/zelctl/server/connection.h"

namespace zelctl {

struct RecoverOptions {
    ConnectionOptions connection;
    std::string from;  ///< identity or name of the client that was lost; empty: the only one
    std::string at;    ///< "YYYY-MM-DD HH:MM[:SS]", local time: configuration and files as of then
    bool yes = false;  ///< bring all shares back without asking
};

/// Lists what clients have left with the server.
void ListDeposits(const RecoverOptions& options, bool as_json);

/// Adds the tasks, paused, and the shares of the machine that was lost, brings the shares' files
/// back, and resumes the tasks whose shares are whole. What this machine has already stays. Called
/// again, it goes on where it broke off. Throws Failure; also when something did not come back.
void Recover(const RecoverOptions& options);

}  // namespace zelctl
