// One run of a task, on a thread of its own.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "programs/common/task_run.h"
#include "programs/zel_daemon/event_loop.h"
#include "programs/zel_daemon/task_record.h"

namespace zel_daemon {

/// A server that has answered, kept from one run of a task to the next so that a change need not
/// look for it again.
class Connection {
public:
    explicit Connection(const ZEL::SyncInfo& info);

    /// Whether the next run may go on with it: it worked, is not old, and these shares still lie
    /// where they did.
    bool Reusable(const std::list<std::string>& shares) const;

    /// Finds the server and asks for the shares, unless that has been done.
    programs::Verdict Ensure(const std::list<std::string>& shares);

    std::atomic<bool> cancel{false};
    std::function<void(const std::string& share, const TARQ::Backup::RunProgress&)> on_progress;
    programs::TaskRun run;

private:
    bool ready_ = false;
    std::chrono::steady_clock::time_point since_;
    std::map<std::string, std::string> folders_;  // of the shares, when they were first looked up
};

/// What a run is to do, and what becomes of it.
struct RunPlan {
    programs::RunOrder order;
    RunRecord record;
    std::vector<uint64_t> events;  ///< the stored changes that it sends
    bool whole = true;             ///< all of each share, not only the changes
};

/// A run under way.
///
/// Threads: the loop's.
class ActiveRun {
public:
    using OnProgress =
        std::function<void(const std::string& share, const TARQ::Backup::RunProgress&)>;
    using OnEnd = std::function<void(const programs::Verdict&, const programs::RunTotals&)>;

    /// Starts it; without a thread to be had it ends as failed. Both functions are called on the
    /// loop's thread, after this; nothing is, once this object is gone.
    ActiveRun(EventLoop& loop, std::shared_ptr<Connection> connection, RunPlan plan,
              OnProgress on_progress, OnEnd on_end);
    /// Cancels and waits for the end.
    ~ActiveRun();
    ActiveRun(const ActiveRun&) = delete;
    ActiveRun& operator=(const ActiveRun&) = delete;

    void Cancel() { connection_->cancel = true; }
    const RunPlan& Plan() const { return plan_; }

    std::string progress_share;  ///< empty until there is progress
    TARQ::Backup::RunProgress progress;

private:
    void Work(EventLoop& loop, const OnProgress& on_progress, const OnEnd& on_end);
    programs::Verdict Run(programs::RunTotals& totals);
    void End(EventLoop& loop, const OnEnd& on_end, const programs::Verdict& verdict,
             const programs::RunTotals& totals);

    std::shared_ptr<Connection> connection_;
    RunPlan plan_;
    std::shared_ptr<bool> alive_ = std::make_shared<bool>(true);  // the loop's thread alone
    bool ended_ = false;                                          // the loop's thread alone
    std::thread thread_;
};

}  // namespace zel_daemon
