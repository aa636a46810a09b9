// Takes what pushes leave in a copy to the share's versions, where no account reaches.
//
// rsync renames what it replaces or deletes into COPY/.zel_versions/ID. That folder belongs to the
// connection while it runs; whatever else is found there is moved by whoever comes next: the end of
// any transfer into the share, the next one's start, the keeping of `serve`. Each move is one
// rename, so an interruption at any time leaves a folder here or there.
//
// Called with the registry's lock held.
#pragma once

#include <string>

namespace zel_server {

/// Before a transfer into the share's copy that leaves its versions in the folder `id`: moves what
/// earlier ones left, and makes COPY/.zel_versions. False when that cannot be made, a folder of
/// that ID is in use, or moves are not settled (copy_moves.h).
bool PrepareVersions(const std::string& share, const std::string& copy, const std::string& id);

/// Moves what no running transfer of the share is writing. Empty folders are removed. Entries that
/// are no run's, from a time when the name was not reserved, become versions themselves. False,
/// with errno set, when something is left that should have been moved.
bool TakeVersions(const std::string& share, const std::string& copy);

}  // namespace zel_server
