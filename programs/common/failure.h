// The one way in which the programs fail: thrown where something cannot be done, caught at each
// program's edge, which makes an exit status or a reply of it.
#pragma once

#include <stdexcept>
#include <string>

namespace programs {

/// What went wrong, as far as callers act on it.
enum class FailureKind {
    kFailed,    ///< the connection, rsync or the server failed: worth another try
    kUsage,     ///< what was asked for is wrong or not there
    kLocal,     ///< something on this machine: a share, its volume, a file, a daemon that is not
                ///< running
    kRefused,   ///< the server refuses: conflict, account, password, switch
    kCancelled  ///< ended by a person
};

class Failure : public std::runtime_error {
public:
    /// `text`: what failed, where and what to do. `status`: the code that a protocol has for it (a
    /// ZEL::ResultCode in the daemon, a server's or rsync's status in a run); 0 where there is
    /// none.
    Failure(FailureKind kind, const std::string& text, int status = 0)
        : std::runtime_error(text), kind_(kind), status_(status) {}

    FailureKind Kind() const { return kind_; }
    int Status() const { return status_; }

private:
    FailureKind kind_;
    int status_;
};

/// What a program that fails so exits with; the manual pages list them.
constexpr int ExitStatusOf(FailureKind kind) {
    switch (kind) {
        case FailureKind::kUsage:
            return 2;
        case FailureKind::kLocal:
            return 3;
        case FailureKind::kRefused:
            return 4;
        case FailureKind::kCancelled:
            return 5;
        default:
            return 1;
    }
}

}  // namespace programs
