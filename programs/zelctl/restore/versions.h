// When a share has changed at its server: the times to restore it as of.
#pragma once

#include <string>

#include "programs/zelctl/server/connection.h"

namespace zelctl {

struct VersionsOptions {
    std::string task;  ///< see RestoreOptions
    ConnectionOptions connection;
    std::string share;
    std::string path;  ///< of the share; empty: all of it
    bool as_json = false;
};

/// Lists what each connection has replaced or deleted, the youngest first. Throws Failure.
void ShowVersions(const VersionsOptions& options);

}  // namespace zelctl
