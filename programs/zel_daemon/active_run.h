// One run of a task, on a thread of its own.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "programs/common/task_run.h"
#include "programs/zel_daemon/loop_worker.h"
#include "programs/zel_daemon/run_index.h"

namespace zel_daemon {

/// A server that has answered, kept from one run of a task to the next so that a change need not
/// look for it again.
class Connection {
public:
    explicit Connection(const ZEL::SyncInfo& info) : info_(info) {}

    /// What to push with. It starts anew when it is old, or when one of these shares lies elsewhere
    /// than it did.
    programs::TaskRun& For(const programs::RunOrder& order);

    /// The server has just taken all of a run: it is where it was.
    void Answered();

    std::atomic<bool> cancel{false};  ///< for good: the next run needs another connection
    std::function<void(const std::string& share, const TARQ::Backup::RunProgress&)> on_progress;

private:
    const ZEL::SyncInfo info_;
    std::unique_ptr<programs::TaskRun> run_;
    std::chrono::steady_clock::time_point since_;
    std::map<std::string, std::string> folders_;  // of the shares, when they were first looked up
};

/// A run under way.
///
/// Threads: the loop's.
class ActiveRun {
public:
    using OnProgress =
        std::function<void(const std::string& share, const TARQ::Backup::RunProgress&)>;
    struct Outcome {
        programs::RunResult result;
        programs::RunTotals totals = {};
        RunIndexes::Linked linked = {};
    };
    using OnEnd = std::function<void(const Outcome&)>;

    /// Starts it; without a thread to be had it ends as failed. Both functions are called on the
    /// loop's thread, after this; nothing is, once this object is gone. `moment`: now, in seconds
    /// since the epoch.
    ActiveRun(EventLoop& loop, std::shared_ptr<Connection> connection, programs::RunOrder order,
              IndexPlace indexes, int64_t moment, const OnProgress& on_progress,
              const OnEnd& on_end);
    /// Cancels and waits for the end.
    ~ActiveRun();
    ActiveRun(const ActiveRun&) = delete;
    ActiveRun& operator=(const ActiveRun&) = delete;

    void Cancel() { connection_->cancel = true; }

    std::string progress_share;  ///< empty until there is progress
    TARQ::Backup::RunProgress progress;

private:
    Outcome Work(const OnProgress& on_progress);
    programs::RunResult NothingDone(const std::string& why) const;

    std::shared_ptr<Connection> connection_;
    programs::RunOrder order_;  // the thread's
    const IndexPlace indexes_;
    const int64_t moment_;
    bool ended_ = false;  // the loop's thread alone
    LoopWorker worker_;
};

}  // namespace zel_daemon
