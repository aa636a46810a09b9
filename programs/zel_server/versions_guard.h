// The library that is loaded into each rsync daemon which serves clients, and keeps what a run has
// put among its versions as it was: see guard/versions_guard.cpp.
#pragma once

#include <string>

namespace zel_server {

/// Set in the environment of the rsync that has it loaded, and of what that runs.
inline constexpr const char* kGuardVariable = "ZEL_VERSIONS_GUARD";

/// Its file, a part of this installation. Throws programs::Failure when it is missing.
std::string VersionsGuard();

}  // namespace zel_server
