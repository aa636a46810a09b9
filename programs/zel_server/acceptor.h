// Accepts the connections that the front forwards. Each gets an rsync daemon process of its own;
// they are counted and ended here.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/unique_fd.h"

namespace zel_server {

/// Accepts connections and answers questions about them (connections.h) until it is told to end.
///
/// The number of connections that have not logged in is limited; when it is reached, the oldest of
/// them is ended to make room. So nobody can lock out others by connecting and staying silent. For
/// use by one thread.
class Acceptor {
public:
    /// Starts to listen. Only root, the process's own user and `front_user` may connect. Throws
    /// Failure.
    explicit Acceptor(uid_t front_user);
    ~Acceptor();
    Acceptor(const Acceptor&) = delete;
    Acceptor& operator=(const Acceptor&) = delete;

    /// Runs until SIGTERM or SIGINT, or until the child process `guarded` (0: none) has ended, and
    /// returns the wait status of that child. The caller must have blocked SIGTERM, SIGINT and
    /// SIGCHLD.
    std::optional<int> Run(pid_t guarded);

private:
    using Clock = std::chrono::steady_clock;

    struct Connection {
        Clock::time_point since = Clock::now();
        std::string account;      // empty until it has logged in
        bool ending = false;      // SIGTERM was sent at `since`; SIGKILL follows
        bool leaderless = false;  // its first process has ended; others of its group have not
    };

    void KeepVersionsWhenDue();
    void Accept();
    void StartDaemon(base::UniqueFd client);
    void Answer();
    std::string AnswerTo(const std::string& question);
    std::string LogIn(const std::string& rest);
    std::string End(const std::string& account);
    void End(pid_t process, Connection& connection);
    void EndOldestWaiting();
    void EndLate();
    void ForgetBuried();
    std::optional<int> Reap(pid_t guarded);
    void EndAll();
    size_t Waiting() const;
    int MillisecondsToWait() const;

    uid_t front_user_;
    base::UniqueFd connections_fd_;
    base::UniqueFd control_fd_;
    base::UniqueFd signals_fd_;
    std::string guard_;  // VersionsGuard()
    std::map<pid_t, Connection> connections_;
    pid_t keeper_ = 0;  // the process that keeps versions; 0: none runs
    Clock::time_point keep_at_ = Clock::now();
    bool space_is_due_ = false;  // IsSpaceDue() since the keeper was started
};

}  // namespace zel_server
