// The one way in which the programs fail: thrown where something cannot be done, caught at each
// program's edge, which makes an exit status or a reply of it.
#pragma once

#include <functional>
#include <stdexcept>
#include <string>

namespace programs {

/// What went wrong, as far as callers act on it.
enum class FailureKind {
    kNone,       ///< nothing: a run that went well
    kFailed,     ///< the connection, rsync or the server failed: worth another try
    kUsage,      ///< what was asked for is wrong or not there
    kLocal,      ///< something on this machine: a share, its volume, a file, a daemon that is not
                 ///< running
    kRefused,    ///< the server refuses: conflict, account, password, switch
    kCancelled,  ///< ended by a person
    kBusy        ///< what was copied changed at the same time: worth another try soon
};

/// What a program that fails so exits with; the manual pages list them.
constexpr int ExitStatusOf(FailureKind kind) {
    return static_cast<int>(kind == FailureKind::kBusy ? FailureKind::kFailed : kind);
}

class Failure : public std::runtime_error {
public:
    /// `text`: what failed, where and what to do. `status`: the code that a protocol has for it (a
    /// ZEL::ResultCode in the daemon, a server's or rsync's status in a run); 0 where there is
    /// none.
    Failure(FailureKind kind, const std::string& text, int status = 0)
        : std::runtime_error(text), kind_(kind), status_(status) {}
    explicit Failure(const std::string& text) : Failure(FailureKind::kFailed, text) {}

    FailureKind Kind() const { return kind_; }
    int Status() const { return status_; }

private:
    FailureKind kind_;
    int status_;
};

/// A call of the system has failed: `what`, with the reason of errno behind it.
Failure SystemFailure(const std::string& what, FailureKind kind = FailureKind::kFailed);

/// A failure that the person has read about already: only its exit status is left. Has no text.
Failure ReportedFailure(FailureKind kind);

/// Writes "program: text" to standard error; nothing when there is no text.
void Report(const char* program, const std::string& text);

/// The edge of a program: runs `command`, reports what it fails with, and gives the exit status.
int RunReporting(const char* program, const std::function<void()>& command);

}  // namespace programs
