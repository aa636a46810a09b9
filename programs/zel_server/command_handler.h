// Carries out the commands of clients.
#pragma once

#include <string>

#include "programs/zel_server/answers.h"
#include "programs/zel_server/command.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Executes one command for the account that has logged in. Every refusal and failure is a status;
/// see docs/server-commands.md for what each command takes and answers.
Answer Execute(const ServerConfig& config, const std::string& account, const Command& command);

/// The whole of `zel_server handle-command`: reads the command from standard input and the account
/// from the rsync daemon's environment, executes it, and writes the answer. Returns the exit code:
/// 0 whenever an answer was written.
int HandleCommand();

}  // namespace zel_server
