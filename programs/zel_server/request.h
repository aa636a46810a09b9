// A command, and who sends it.
#pragma once

#include <string>

#include "programs/zel_server/command.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

struct Request {
    const ServerConfig& config;
    const std::string& account;
    const Command& command;

    const std::string& Client() const { return command.client_id; }
};

}  // namespace zel_server
