// When a share, or what is at a path of it, has changed.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "programs/zel_server/version_store.h"

namespace zel_server {

/// What one connection has replaced or deleted there, or what was moved away.
struct PathVersion {
    VersionTime until;                 ///< when the connection ended, or the move was made
    std::optional<VersionTime> since;  ///< of a single file: when it came there
    uint64_t files = 0;
    uint64_t bytes = 0;  ///< their sizes
};

/// Calls `visit` for each version below `path` (relative; empty: all) of the share whose copy is at
/// `copy`, the youngest first. Returns false when older ones were left out: `visit` said false,
/// more than a million files were counted, or the path was moved too often. Throws
/// std::system_error.
bool VisitVersions(const std::string& share, const std::string& copy, const std::string& path,
                   const std::function<bool(const PathVersion&)>& visit);

}  // namespace zel_server
