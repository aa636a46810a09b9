// Whose copy a command is about: a task's, or that of a server which the command line names.
#pragma once

#include <string>

#include "ZEL/sync_obj.h"
#include "programs/zelctl/server/connection.h"

namespace zelctl {

/// A share at its server, and how that is reached.
struct CopySource {
    ZEL::SyncInfo info;
    std::string share;
};

/// From the task of this name, which the daemon knows; its stored password is used when this user
/// may have it, and else asked for. `share` may be empty when the task has only one. Without a
/// task's name: from `connection`. Throws Failure.
CopySource FindSource(const std::string& task, std::string share,
                      const ConnectionOptions& connection);

}  // namespace zelctl
