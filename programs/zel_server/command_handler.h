// Carries out the commands of clients.
#pragma once

#include <string>

#include "programs/zel_server/answers.h"
#include "programs/zel_server/command.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Executes one command for the account that has logged in. Refusals and failures become a status;
/// docs/server-commands.md describes each command and its answer.
Answer Execute(const ServerConfig& config, const std::string& account, const Command& command);

/// Implements `zel_server handle-command`: reads the command from standard input and the account
/// from the rsync daemon's environment, executes it, and writes the answer. Returns the exit code,
/// 0 whenever an answer was written.
int HandleCommand();

/// Implements `zel_server begin-push`: reads a start command in the same way, for a push that ends
/// with this connection. Exit code 0 admits it; otherwise the rsync daemon ends the connection, and
/// the client goes another way.
int BeginPush();

}  // namespace zel_server
