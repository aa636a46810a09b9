// What the daemon does: keeps the tasks, knows when each is due, starts its runs and takes down how
// they ended.
#pragma once

#include <list>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "programs/zel_daemon/active_run.h"
#include "programs/zel_daemon/change_set.h"
#include "programs/zel_daemon/daemon_config.h"
#include "programs/zel_daemon/event_loop.h"
#include "programs/zel_daemon/recovery_watch.h"
#include "programs/zel_daemon/share_debts.h"
#include "programs/zel_daemon/store.h"
#include "programs/zel_daemon/task_plan.h"
#include "programs/zel_daemon/task_record.h"
#include "programs/zel_daemon/watcher.h"

namespace zel_daemon {

/// How far the folders of a realtime task's shares are watched.
struct TaskWatch {
    size_t folders = 0;
    bool searching = false;  ///< folders are still being found
    bool complete = true;    ///< no folder that was found is left out
    std::string problem;     ///< why it is not complete
};

/// What a person sees of a task beside its settings.
struct TaskState {
    ZEL::TASK_STATUS status = ZEL::TASK_STATUS_IDLE;
    std::optional<int64_t> next_run;  ///< seconds since the epoch
    std::optional<int64_t> retry_in;  ///< seconds
    uint64_t pending = 0;             ///< changes that wait
    std::string note;                 ///< what a person should know
    std::optional<TaskWatch> watch;   ///< of a realtime task that is not paused
    const ActiveRun* active = nullptr;
    const RunRecord* last = nullptr;  ///< the last run that ended
};

struct ServiceStats {
    size_t tasks = 0;
    size_t running = 0;
    unsigned int workers = 0;
    WatchStats watched;
};

/// A realtime task lives so: its shares' folders are searched and watched; once that is done all is
/// compared whole, for what has changed unwatched; from then on changes are gathered for a short
/// while, folded, stored, sent, and forgotten only when the server has taken them. Whatever makes
/// the watch incomplete leads back to a whole comparison.
///
/// Threads: the loop's. Operations that a person asks for throw RequestError (task_map.h) or
/// StoreError, and have changed nothing then.
class Service {
public:
    /// `on_change` is called whenever what a person sees may have changed.
    Service(EventLoop& loop, const Clock& clock, Store& store, const DaemonConfig& config,
            std::function<void()> on_change);
    /// Cancels the runs, and stores that they were stopped.
    ~Service();
    Service(const Service&) = delete;
    Service& operator=(const Service&) = delete;

    /// Loads the tasks and begins.
    void Start();
    void SetConfig(const DaemonConfig& config);
    /// Shares may lie elsewhere now, the clock or the time zone may have been changed.
    void Refresh();

    /// What waits for its next try because of something of this kind is tried soon: once in a
    /// while, however often this is called.
    void MayHaveRecovered(Recovery what);

    /// Stores a new task and gives it its id.
    const TaskRecord& Add(TaskRecord record);
    /// Replaces the settings of task `name` by those of `record`, which may have another name.
    const TaskRecord& Edit(const std::string& name, TaskRecord record);
    void Remove(const std::string& name);
    /// Runs it as soon as a worker is free. The id of the last run that ended by now, or 0.
    uint64_t RequestRun(const std::string& name);
    void Cancel(const std::string& name);
    void SetPaused(const std::string& name, bool paused);

    /// REQUIRES that there is such a task, else RequestError.
    const TaskRecord& Find(const std::string& name) const;
    std::vector<const TaskRecord*> Tasks() const;  ///< by name
    TaskState StateOf(const TaskRecord& record) const;
    std::vector<RunRecord> Runs(const std::string& name, unsigned int limit);
    ServiceStats Stats() const;

private:
    struct Task;
    struct Due {
        RunReason reason;
        bool all;  // whatever is owed
    };

    Task& Get(const std::string& name) const;
    void CheckNameFree(const std::string& name, uint64_t id) const;
    Task& Insert(TaskRecord record);
    void Reset(Task& task);

    // Changes on disk.
    void OnChange(const std::string& share, const std::string& path);
    void OnLoss(const std::string& share, const WatchLoss& loss);
    void Note(const std::string& share, const std::string& note);
    void ListenToWatcher();
    void WatchShares();
    void WatchAgain(const Task& task);
    void PostWatcher();
    void RunWatcher();
    bool PollDue(const Task& task) const;
    void SearchAgain(Task& task);
    std::optional<TaskWatch> WatchOf(const Task& task) const;
    void ForgetSettledNotes(Task& task);
    void StoreGathered(Task& task);
    bool GatherDue(const Task& task, int64_t now) const;

    // Runs.
    void Advance();
    std::optional<Due> WhatIsDue(Task& task);
    bool MayStart(const Task& task, const Due& due) const;
    void StartRun(Task& task, const Due& due);
    bool FillOrder(Task& task, RunPlan& plan);
    void EndRun(Task& task, const programs::RunResult& result, const programs::RunTotals& totals);
    void Settle(Task& task, const RunPlan& plan, const programs::RunResult& result);
    void PutBack(Task& task);
    void HastenRetries();
    void StoreEnd(Task& task);
    void StoreFailed(Task& task, const StoreError& error);
    RetryDelays Delays() const;
    void SetAlarm();
    std::optional<int64_t> UntilNextStep(const Task& task) const;
    std::optional<int64_t> UntilRetry(const Task& task) const;
    static std::string WaitsFor(const Task& task);

    EventLoop& loop_;
    const Clock& clock_;
    Store& store_;
    DaemonConfig config_;
    std::function<void()> on_change_;
    Watcher watcher_;
    std::map<std::string, std::string> watched_;  // shares and their folders
    bool watcher_heard_ = false;                  // the loop calls when it can be read
    bool watcher_posted_ = false;                 // folders are left to search
    std::set<Recovery> recovered_;
    int64_t look_at_ = 0;  // when to look what has recovered; while there is something in it
    std::map<uint64_t, std::unique_ptr<Task>> tasks_;
    std::map<std::string, Task*> by_name_;
};

}  // namespace zel_daemon
