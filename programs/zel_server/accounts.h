// The accounts that may log in: the rsync daemon's secrets file.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace zel_server {

struct Account {
    std::string name;
    bool enabled = true;  ///< false: it keeps its password, but may not log in
    bool weak = false;    ///< the password is shorter than is required of new ones
};

/// All accounts, in the file's order; nothing when the file cannot be read.
std::optional<std::vector<Account>> Accounts();

/// Whether the account still exists and is enabled. The rsync daemon has already checked the
/// password; the account may have changed since.
bool MayLogIn(const std::string& name);

/// Adds an account, or changes its password; a disabled one stays disabled. False, with errno set,
/// on failure.
bool SetAccount(const std::string& name, const std::string& password);

/// Removes an account; enables or disables it. The copies of its shares are kept. False, with errno
/// set (ENOENT: no such account), on failure.
bool RemoveAccount(const std::string& name);
bool EnableAccount(const std::string& name, bool enabled);

/// A random password of 20 characters without easily confused ones. Throws Failure when the system
/// has no random bytes.
std::string MakePassword();

/// Whether a password is long enough for a new account.
bool IsLongEnough(const std::string& password);

}  // namespace zel_server
