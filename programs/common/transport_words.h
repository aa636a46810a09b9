// Text about how a server is reached.
#pragma once

#include <string>

#include "tarq/rsync_servers.h"

namespace programs {

/// "TLS, port 874, key SHA256:..."
std::string TransportWords(const TARQ::Backup::RsyncServer& server);

/// The same for a task's server, according to the file of servers or, if it is not listed there,
/// the task. If that file cannot be read, the error text.
std::string TransportWords(const std::string& server, bool task_says_ssh,
                           unsigned int task_ssh_port);

}  // namespace programs
