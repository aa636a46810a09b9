// The commands about this machine's shares.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

void AddShare(const std::string& name, const std::string& path, bool acl, bool windows);
/// Shows what the share was known by and what its folder is now, and records that when a person (or
/// `yes`) says that it is the right one.
void ConfirmShare(const std::string& name, bool yes);
void RemoveShare(const std::string& name, bool force);
void ListShares(bool as_json);

/// All shares of the catalogue, in its order.
std::vector<std::string> ShareNames();

/// Throws Failure for the first share that is not in the catalogue, whose folder cannot be read, or
/// whose volume is not there or not fit for syncing.
void CheckShares(const std::vector<std::string>& names);

}  // namespace zelctl
