// The commands about this machine's shares.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "programs/zelctl/base/exit_codes.h"

namespace zelctl {

ExitCode AddShare(const std::string& name, const std::string& path, bool acl, bool windows);
/// Shows what the share was known by and what its folder is now, and records that when a person (or
/// `yes`) says that it is the right one.
ExitCode ConfirmShare(const std::string& name, bool yes);
ExitCode RemoveShare(const std::string& name, bool force);
ExitCode ListShares(bool as_json);

/// All shares of the catalogue, in its order; nothing, and the reason told, when it cannot be read.
std::optional<std::vector<std::string>> ShareNames();

/// Complains about the first share that is not in the catalogue, whose folder cannot be read, or
/// whose volume is not there or not fit for syncing.
ExitCode CheckShares(const std::vector<std::string>& names);

}  // namespace zelctl
