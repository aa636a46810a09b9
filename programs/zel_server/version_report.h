// What is kept of files that were replaced or deleted, for the admin.
#pragma once

#include <cstdint>
#include <string>

#include "programs/zel_server/version_store.h"

namespace zel_server {

/// The number of files and their bytes in a folder of versions.
struct VersionSize {
    uint64_t files = 0;
    uint64_t bytes = 0;
};
VersionSize SizeOf(const VersionFolder& version);

/// `zel_server versions`: of each share how many there are, since when, and how much they take; of
/// one share each of them.
void ShowVersions(const std::string& share, bool as_json);

}  // namespace zel_server
