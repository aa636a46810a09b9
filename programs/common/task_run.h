// Runs of shares against their server, from finding the server to the final report; shared by the
// daemon's workers and `zelctl push`.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "ZEL/sync_obj.h"
#include "programs/common/run_result.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// Callbacks on the running thread; each may be empty.
struct RunListener {
    std::function<void(const std::string& share, const TARQ::Backup::RunProgress&)> on_progress;
    std::function<void(const std::string& share, const TARQ::Backup::RunReport&, double seconds)>
        on_share_done;
    std::function<void(const std::string& address)> on_paired;
};

/// Called for each line of what a run would do.
using ChangeHandler = std::function<void(const std::string& share, const TARQ::Backup::RunChange&)>;

/// A connection to one server with one task's settings. Failures are thrown as RunFailure.
///
/// Threads: for use by one thread; `cancel` may be set by any thread, and by a signal handler.
class TaskRun {
public:
    /// `cancel` must outlive this object. When it becomes true, the current operation ends with
    /// kCancelled within a second, or within six when the server does not answer.
    TaskRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel, RunListener listener = {});
    ~TaskRun();
    TaskRun(const TaskRun&) = delete;
    TaskRun& operator=(const TaskRun&) = delete;

    /// Finds an address at which the server answers. Changes nothing there.
    void Connect();
    /// Asks whether the server accepts these shares from this client. Changes nothing there.
    void CheckPairing(const std::vector<std::string>& shares);
    /// Pushes one share after the other. Connects first unless that was done, and pairs if the
    /// server does not know this client. A failure of a share or path does not keep the others from
    /// being pushed, unless it affects the whole run. A share that changes while it is copied is
    /// copied again, at most a few times.
    RunResult Push(const RunOrder& order, RunTotals& totals);
    /// Lists what Push() would send and delete, and calls `on_missing` for a share of which the
    /// server has no copy. Changes nothing.
    void List(const RunOrder& order, const ChangeHandler& on_change,
              const std::function<void(const std::string& share)>& on_missing);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace programs
