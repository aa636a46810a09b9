// Runs of shares against their server, from the first probe to the last word: what the daemon's
// workers and `zelctl push` do alike.
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

/// Told on the running thread; each may be empty.
struct RunListener {
    std::function<void(const std::string& share, const TARQ::Backup::RunProgress&)> on_progress;
    std::function<void(const std::string& share, const TARQ::Backup::RunReport&, double seconds)>
        on_share_done;
    std::function<void(const std::string& address)> on_paired;
};

/// One line of what a run would do.
using ChangeHandler = std::function<void(const std::string& share, const TARQ::Backup::RunChange&)>;

/// A connection to one server with one task's settings. What cannot be done is thrown: RunFailure.
///
/// Threads: belongs to one thread; `cancel` may be set by any, and by a signal handler.
class TaskRun {
public:
    /// `cancel` outlives this object; when it is true the operation under way ends within a second,
    /// with kCancelled; within two when the server does not answer.
    TaskRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel, RunListener listener = {});
    ~TaskRun();
    TaskRun(const TaskRun&) = delete;
    TaskRun& operator=(const TaskRun&) = delete;

    /// Finds an address of the server that answers. Changes nothing there.
    void Connect();
    /// Asks whether the server takes these shares from this client. Changes nothing there.
    void CheckPairing(const std::vector<std::string>& shares);
    /// Pushes share after share, after Connect() unless that was done, pairing when the server does
    /// not know this client. Shares and paths that fail do not keep the others from being pushed,
    /// unless the failure is one of the whole run. A share that changes while it is copied is
    /// copied once more, a few times at most.
    RunResult Push(const RunOrder& order, RunTotals& totals);
    /// Tells what Push() would send and delete. A share of which the server holds no copy is told
    /// to `on_missing`. Changes nothing.
    void List(const RunOrder& order, const ChangeHandler& on_change,
              const std::function<void(const std::string& share)>& on_missing);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace programs
