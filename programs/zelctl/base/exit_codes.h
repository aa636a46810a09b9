#pragma once

#include "programs/common/task_run.h"

namespace zelctl {

/// What zelctl exits with; the manual page lists them.
enum ExitCode : int {
    kOk = 0,
    kFailed = 1,    ///< the connection, rsync or the server failed
    kUsage = 2,     ///< the command line is wrong
    kLocal = 3,     ///< something on this machine: a share, its volume, a file
    kRefused = 4,   ///< the server refuses: conflict, account, switch
    kCancelled = 5  ///< ended by the user
};

/// What a run's end comes to.
ExitCode CodeOf(programs::Trouble trouble);

/// Prints "zelctl: message" and gives `code` back.
ExitCode Fail(ExitCode code, const char* format, ...) __attribute__((format(printf, 2, 3)));

}  // namespace zelctl
