// Requests to the running `zel_server serve`, which accepts, counts and ends the connections of the
// rsync daemon. It takes them on a Unix socket that is open only to root and to the user who runs
// it.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace zel_server {

/// Limits on simultaneous connections: of one account, and of all accounts together; of those that
/// have not logged in (the oldest of which is ended to make room), and the seconds allowed for a
/// log-in.
inline constexpr size_t kMaxAccountConnections = 16;
inline constexpr size_t kMaxConnections = 512;
inline constexpr size_t kMaxWaiting = 64;
inline constexpr int kLoginSeconds = 30;
/// Idle time in seconds after which a connection is ended.
inline constexpr int kSilentSeconds = 600;
/// The longest that an account's client can ask for (rsync's --timeout, of a verification).
inline constexpr int kLongestSilence = 86400;

/// Whether a connection that has logged in may go on.
enum class Admission {
    kAdmitted,
    kTooMany,   ///< the account has reached its limit
    kNotServed  ///< not a connection of `serve`, or it is being ended; `serve` does not run; or the
                ///< account was removed or disabled in the meantime
};
/// Called by programs that the rsync daemon runs: reports to `serve` that the connection of the
/// process RSYNC_PID has logged in as RSYNC_USER_NAME.
Admission AdmitConnection();

/// Ends every connection of `account`, with all processes of it. Returns their number; 0 also when
/// no daemon runs.
size_t EndConnections(const std::string& account);

/// The process that runs `zel_server serve` for this server; nothing when none does, or when this
/// user may not see it.
std::optional<pid_t> ServingProcess();

/// The sockets of `serve`: for connections, which the front forwards, and for these requests.
std::string FrontSocket();
std::string ControlSocket();

}  // namespace zel_server
