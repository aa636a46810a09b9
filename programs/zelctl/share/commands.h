// The commands for the shares of this machine.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

void AddShare(const std::string& name, const std::string& path, bool acl, bool windows);
/// Shows the recorded identity of the share's folder and its present one, and records the latter
/// when a person (or `yes`) confirms that it is the right folder.
void ConfirmShare(const std::string& name, bool yes);
void RemoveShare(const std::string& name, bool force);
void ListShares(bool as_json);

/// All shares of the catalogue, in the order of the catalogue.
std::vector<std::string> ShareNames();

/// Throws Failure for the first share that is not in the catalogue, whose folder cannot be read, or
/// whose volume is missing or not suitable.
void CheckShares(const std::vector<std::string>& names);

}  // namespace zelctl
