// What the daemon does: keeps the tasks, and does for each what its machine says, above all runs.
#pragma once

#include <sys/stat.h>

#include <functional>
#include <list>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "programs/zel_daemon/active_run.h"
#include "programs/zel_daemon/daemon_config.h"
#include "programs/zel_daemon/event_loop.h"
#include "programs/zel_daemon/index_search.h"
#include "programs/zel_daemon/place_watch.h"
#include "programs/zel_daemon/preview_run.h"
#include "programs/zel_daemon/store.h"
#include "programs/zel_daemon/task_machine.h"
#include "programs/zel_daemon/verification.h"
#include "programs/zel_daemon/verify_run.h"
#include "programs/zel_daemon/watcher.h"

namespace zel_daemon {

/// How far the folders of a realtime task's shares are watched.
struct TaskWatch {
    size_t folders = 0;
    bool scanning = false;  ///< folders are still being found
    bool complete = true;   ///< no folder that was found is left out
    std::string problem;    ///< why it is not complete
};

/// What a person sees of a task beside its settings.
struct TaskState {
    ZEL::TASK_STATUS status = ZEL::TASK_STATUS_IDLE;
    std::optional<int64_t> next_run;  ///< seconds since the epoch
    std::optional<int64_t> retry_in;  ///< seconds
    uint64_t pending = 0;             ///< changes that wait
    std::string note;                 ///< what a person should know
    std::optional<TaskWatch> watch;   ///< of a realtime task that is not paused
    uint64_t run = 0;                 ///< the run under way; 0: none is
    const ActiveRun* active = nullptr;
    const RunRecord* last = nullptr;         ///< the last run that ended
    const Questions* asking = nullptr;       ///< what waits for a person; never null
    const Verification* verified = nullptr;  ///< how far its copies are; never null
    std::string verify_problem;              ///< why they are not; empty when all is well
};

struct ServiceStats {
    size_t tasks = 0;
    size_t running = 0;
    unsigned int workers = 0;
    size_t damaged = 0;  ///< files, see Verification
    WatchStats watched;
};

/// When a task does what, its TaskMachine knows. The service tells it what happens on disk, on this
/// host and among people, does what it wants done, and picks the tasks that run: no more at a time
/// than there are workers, no share in two runs at a time, who is due longest goes first. Where
/// all workers are taken, one more is there for each server that has none, so that a server which
/// never comes to an end holds up its own tasks alone.
///
/// Threads: the loop's. Operations that a person asks for throw RequestError() (task_map.h)
/// or a failure of the store, and have changed nothing then.
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
    /// Lets go once what the task asks a person about, as soon as a worker is free. What
    /// RequestRun() returns.
    uint64_t Confirm(const std::string& name);
    void Cancel(const std::string& name);
    /// Finds out what a run of the task would do, as soon as a worker is free. `verified`: instead
    /// reads these files at both ends, and sends what a realtime task has missed.
    std::shared_ptr<PreviewFeed> Preview(
        const std::string& name,
        const std::optional<std::vector<programs::ShareOrder>>& verified = std::nullopt);
    void SetPaused(const std::string& name, bool paused);

    /// REQUIRES that there is such a task, else RequestError().
    const TaskRecord& Find(const std::string& name) const;
    std::vector<const TaskRecord*> Tasks() const;  ///< by name
    TaskState StateOf(const TaskRecord& record) const;
    std::vector<RunRecord> Runs(const std::string& name, unsigned int limit);
    ServiceStats Stats() const;

private:
    struct Task {
        TaskMachine machine;
        std::shared_ptr<Connection> connection = {};
        std::unique_ptr<ActiveRun> active = {};
        uint64_t pending = 0;  // stored changes, those being sent included
        Verification verification = {};
        int64_t verify_at = 0;            // not before this moment
        std::string verify_problem = {};  // of the last slice
        unsigned int gave_way = 0;        // so often has it been ended at its place
        // Shares whose index is in step with the copy, with their number of ToSearch().
        std::map<std::string, uint64_t> searchable = {};
    };
    /// A share that tasks want watched.
    struct WatchedShare {
        std::string folder;        // that is watched; empty: none is
        std::string path;          // where it was last
        struct stat place = {};    // what the path led to then
        std::string problem;       // why it is not watched in full, for people
        std::vector<Task*> tasks;  // that want it
        // What is mounted below it; nothing: not looked at yet.
        std::optional<std::vector<std::string>> mounts;
    };
    /// What the runs under way leave for others.
    struct Room {
        unsigned int running = 0;
        std::set<std::string> servers;  // of these
        std::set<std::string> in_use;   // shares
    };
    /// A preview that somebody waits for, or looks at.
    struct PreviewJob {
        int64_t since;
        ZEL::SyncInfo info;
        programs::RunOrder order;
        std::shared_ptr<PreviewFeed> feed;
        // What is damaged, of a verification: by share and path.
        std::map<std::string, std::map<std::string, uint64_t>> damaged = {};
        std::unique_ptr<PreviewRun> run = {};  // once it has a worker
    };
    /// What waits for a worker.
    struct Due {
        int64_t since;
        Task* task;  // with its step, or
        Step step;
        PreviewJob* preview;
    };

    Task& Get(const std::string& name) const;
    void CheckNameFree(const std::string& name, uint64_t id) const;
    Task& Insert(TaskRecord record);

    // The watch.
    void OnChange(const std::string& share, const std::string& path);
    void OnMove(const std::string& share, const std::string& from, const std::string& to);
    void OnLoss(const std::string& share, const WatchLoss& loss);
    void LoseForLong(const std::string& share, const std::string& problem);
    void ListenToWatcher();
    void WatchShares();
    void LookAtMounts();
    bool IsAtItsPlace(const std::string& share) const;
    void WatchAgain(const Task& task);
    void ForgetSettledProblems(const Task& task);
    void PostWatcher();
    void RunWatcher();
    bool IsCovered(const std::string& share) const;
    std::optional<TaskWatch> WatchOf(const Task& task) const;

    // Steps and runs.
    void Advance();
    Step DoChores(Task& task);
    void StoreEnd(Task& task);
    void StoreChanges(Task& task);
    void StoreFailed(Task& task, const programs::Failure& failure);
    void Rescan(Task& task);
    void TakeRoom(const Task& task, Room& room) const;
    static void TakeWorker(const ZEL::SyncInfo& info, Room& room);
    bool HasWorker(const ZEL::SyncInfo& info, const Room& room) const;
    bool MayStart(const Task& task, const Step& step, const Room& room) const;
    void StartPreview(PreviewJob& job);
    programs::ChangeHandler SendDifferences(PreviewJob& job);
    void StartRun(Task& task, const Step& step);
    void EndRun(Task& task, const ActiveRun::Outcome& outcome);
    void HastenRetries();

    // The search for what changed unnoticed.
    IndexPlace IndexesOf(const TaskRecord& record) const;
    void DropIndexes(uint64_t task_id);
    void DropLeftIndexes() const;
    void SearchSome();
    bool IsSearchable(const Task& task, const std::string& share) const;
    bool IsWanted(const SearchOrder& order) const;
    void StartSearch(Task& task, const std::string& share, uint64_t number);
    void EndSearch(const SearchOutcome& outcome);

    // Verification.
    void SetVerification(Task& task, bool other_copies);
    void VerifySome(bool others_wait, std::optional<int64_t>& wait);
    Task* NextToVerify(std::string& share, std::optional<int64_t>& wait);
    void StartSlice(Task& task, const std::string& share);
    void EndSlice(const VerifyOutcome& outcome);
    void StoreSlice(Task& task, const std::string& share, VerifiedSlice slice);
    void GiveWay(Task& task);
    void ForgetReplaced(Task& task, const programs::RunResult& result);
    void NoteVerified(const programs::RunOrder& order,
                      const std::map<std::string, std::map<std::string, uint64_t>>& damaged);
    void SendDifference(Task& task, const std::string& share, const std::string& path, bool all);

    EventLoop& loop_;
    const Clock& clock_;
    Store& store_;
    const std::string indexes_;  // the folder of all tasks' indexes
    DaemonConfig config_;
    std::function<void()> on_change_;
    Watcher watcher_;
    PlaceWatch places_;  // of the shares that are watched
    std::map<std::string, WatchedShare> shares_;
    bool watcher_heard_ = false;   // the loop calls when it can be read
    bool watcher_posted_ = false;  // folders are left to scan
    std::set<Recovery> recovered_;
    int64_t look_at_ = 0;  // when to look what has recovered; while there is something in it
    std::list<PreviewJob> previews_;
    int64_t verify_at_ = 0;       // when the next slice of any task may begin
    uint64_t verified_task_ = 0;  // the last that had one
    std::unique_ptr<VerifyRun> verify_;
    std::unique_ptr<IndexSearch> search_;
    std::map<uint64_t, Task> tasks_;
    std::map<std::string, Task*> by_name_;
};

}  // namespace zel_daemon
