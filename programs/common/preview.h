// What a push would do, or in what the two ends differ, found out without changing anything; used
// by the daemon's workers and `zelctl push`.
#pragma once

#include <functional>
#include <string>

#include "programs/common/task_run.h"

namespace programs {

/// What a push would do with one share.
struct PreviewSum {
    uint64_t files = 0;  ///< number that would be sent
    uint64_t bytes = 0;  ///< their total size
    uint64_t deletions = 0;
    uint64_t damaged = 0;  ///< of `files`: other bytes under the same size and time
    bool missing = false;  ///< the server has no copy yet: everything would be sent
};

/// Called on the running thread.
struct PreviewListener {
    ChangeHandler on_change;  ///< for each file to send and each entry to delete
    std::function<void(const std::string& share, const PreviewSum&)> on_share;
};

/// Connects, asks whether the server accepts the shares, and lists the changes share by share.
/// Changes nothing. Throws RunFailure.
void Preview(TaskRun& run, const RunOrder& order, const PreviewListener& listener);

/// "send    path (1.5 KiB)", "delete  path"; printable.
std::string ChangeLine(const TARQ::Backup::RunChange& change);
/// "docs: 2 files (1.5 KiB) would be sent, 0 deleted."
std::string SumLine(const std::string& share, const PreviewSum& sum);

/// "DAMAGED path (1.5 KiB)", "differs path (1.5 KiB)", "extra   path"; printable.
std::string DifferenceLine(const TARQ::Backup::RunChange& change);
/// "docs: 1 file is damaged, 2 are missing or other at the server, 0 too many there."
std::string DifferencesLine(const std::string& share, const PreviewSum& sum);

}  // namespace programs
