// Brings files of a share back from its server.
#pragma once

#include <string>
#include <vector>

#include "programs/zelctl/restore/source.h"
#include "programs/zelctl/server/connection.h"

namespace zelctl {

struct RestoreOptions {
    std::string task;              ///< whose server, account and password are used; or:
    ConnectionOptions connection;  ///< the server, when `task` is empty
    std::string share;             ///< may be empty for a task with one share
    std::string folder;
    std::vector<std::string> paths;  ///< of the share; empty: all of it
    std::string at;  ///< "YYYY-MM-DD HH:MM[:SS]", local time; empty: as the copy is now
    bool overwrite = false;
    bool dry_run = false;
    bool quiet = false;
};

/// Brings the files back into the folder, which is made when it is missing. Throws Failure.
void Restore(const RestoreOptions& options);
/// The same from a source that was found already; `task`, `connection` and `share` of the options
/// are not looked at.
void RestoreFrom(const CopySource& source, const RestoreOptions& options);

}  // namespace zelctl
