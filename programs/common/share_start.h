// How a share's push begins at the server. Failures are thrown as RunFailure.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "programs/common/server_session.h"

namespace programs {

class CopyPush;

/// How far the failure of a command for one share also affects the others.
Reach ReachOfCommand(int status);

/// Has the server take these shares from this client, or with `dry_run` asks whether it would. As
/// many commands as their names need.
void PairShares(ServerSession& session, bool dry_run, const std::vector<std::string>& shares);

/// Announces the start of a share, and pairs first if the server does not know this client; then
/// `on_paired` (may be empty) is told its address. Only this share is paired: one that the server
/// refuses must not affect the others.
void StartShare(ServerSession& session, const std::string& share, CopyPush& copy,
                const std::function<void(const std::string& address)>& on_paired);

/// Sends the key of a share that this machine keeps encrypted; of others nothing.
void SendShareKey(ServerSession& session, const std::string& share);

}  // namespace programs
