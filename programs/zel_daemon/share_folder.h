// A share's folder at this machine, and single entries in it.
#pragma once

#include <optional>
#include <string>

#include "base/unique_fd.h"
#include "programs/zel_daemon/entry_facts.h"

namespace zel_daemon {

/// Opens a share's folder (O_PATH). While it is open, the volume it lies on cannot be unmounted.
/// Throws Failure when there is no such folder.
base::UniqueFd OpenShareFolder(const std::string& folder);

/// The facts of the entry at `path` ("/photos/a.jpg"; "/": the folder itself) in the open folder of
/// a share, as they are now. Links are not followed. Nothing when they cannot be had.
std::optional<EntryFacts> FactsAt(const base::UniqueFd& share, const std::string& path);

}  // namespace zel_daemon
