// How `zel_server setup` prepares the storage folders.
#pragma once

#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Creates each storage folder, closes it to others, and records which disk it is on. Prints that,
/// with a note on whatever is unusual. Throws Failure when one cannot be used. The permissions of
/// an existing folder are changed only if it contains nothing but copies.
void TakeStorage(const ServerConfig& config);

/// For the start of the server. Storage that an earlier version has set up is closed here; once all
/// of its folders were there and closed, open storage is refused. Throws Failure (kUsage: a retry
/// does not help) when a folder cannot be closed, or is open again.
void RequireClosedStorage(ServerConfig& config);

/// Moves copies that others can access into a storage folder on the same disk, and updates the
/// registry. It can be interrupted at any time, and continues when it is called again; until then
/// pushes into these copies are refused. Called with the registry's lock held. Prints what it did.
void MoveOpenCopies(const ServerConfig& config);

}  // namespace zel_server
