// The accounts that may log in: the rsync daemon's secrets file.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace zel_server {

/// Names of all accounts, in the file's order; nothing when the file cannot be read.
std::optional<std::vector<std::string>> Accounts();

/// Adds an account, or gives it a new password. False, with errno set, on failure.
bool SetAccount(const std::string& name, const std::string& password);

/// Removes an account; its shares' copies stay. False, with errno set (ENOENT: there is none), on
/// failure.
bool RemoveAccount(const std::string& name);

}  // namespace zel_server
