// The one error type of the programs: thrown where something fails, and turned into an exit status
// or a reply at the outermost level of each program.
#pragma once

#include <functional>
#include <stdexcept>
#include <string>

namespace programs {

/// What kind of problem it was, as far as callers need to know.
enum class FailureKind {
    kNone,       ///< no failure
    kFailed,     ///< the connection, rsync or the server failed: a retry may help
    kUsage,      ///< the request is wrong, or what it names does not exist
    kLocal,      ///< a problem on this machine: share, volume, file, a daemon that is not running
    kRefused,    ///< the server refuses: conflict, account, password, switch
    kCancelled,  ///< ended by a person
    kConfirm,    ///< it waits until a person allows it
    kBusy        ///< files changed while they were copied: an early retry may help
};

/// The exit status of a program for this kind of failure; the manual pages list them.
constexpr int ExitStatusOf(FailureKind kind) {
    return static_cast<int>(kind == FailureKind::kBusy ? FailureKind::kFailed : kind);
}

class Failure : public std::runtime_error {
public:
    /// `text`: what failed, where, and what to do. `status`: the code for it in a protocol (a
    /// ZEL::ResultCode in the daemon, a status of the server or of rsync in a run); 0 if there is
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

/// A failed system call: `what`, followed by the error text of errno.
Failure SystemFailure(const std::string& what, FailureKind kind = FailureKind::kFailed);

/// A failure whose text was already printed: only the exit status is left. Its text is empty.
Failure ReportedFailure(FailureKind kind);

/// Writes "program: text", made printable, to standard error; nothing when the text is empty.
void Report(const char* program, const std::string& text);

/// The outermost level of a program: runs `command`, reports its failure and returns the exit
/// status.
int RunReporting(const char* program, const std::function<void()>& command);

}  // namespace programs
