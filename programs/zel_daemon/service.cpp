#include "programs/zel_daemon/service.h"

#include <algorithm>
#include <iterator>
#include <utility>

#include "ZEL/channel.h"
#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/task_map.h"

namespace zel_daemon {

namespace {

using programs::RunTotals;
using programs::Trouble;
using programs::Verdict;
using ZEL::Logger;

// The watcher's share of the loop's time before others have their turn.
constexpr std::chrono::milliseconds kWatcherSlice(20);
// A store that could not be written is tried again after so long.
constexpr int64_t kStoreRetryMs = 10 * 1000;
// A timer for something that is far off is set again now and then.
constexpr int64_t kLongestWaitMs = int64_t{24} * 3600 * 1000;

// A run whose end is still to be stored.
struct EndedRun {
    RunRecord record;
    std::vector<uint64_t> events;  // that it was to send
};

constexpr char kStopped[] = "the daemon was stopped; the next run completes the copy";

}  // namespace

/// A task and all that goes on with it.
struct Service::Task {
    Task(TaskRecord kept, const Clock& clock) : record(std::move(kept)) { MakePlan(clock); }

    void MakePlan(const Clock& clock) {
        plan.emplace(clock, record.Info().GetSchedule(), record.checked_until);
    }

    bool HasGathered() const { return gather_first.has_value(); }
    bool HasShare(const std::string& share) const {
        const std::list<std::string>& shares = record.Info().GetShareList();
        return std::find(shares.begin(), shares.end(), share) != shares.end();
    }
    bool Watches() const { return record.IsRealtime() && !record.paused; }

    TaskRecord record;
    std::optional<TaskPlan> plan;  // always there
    std::shared_ptr<Connection> connection;
    std::unique_ptr<ActiveRun> active;
    std::optional<EndedRun> ended;  // the store does not know of its end yet
    bool by_person = false;         // the run under way was cancelled by a person
    bool requested = false;         // a person wants a run
    int64_t due_since = 0;          // on the clock that never jumps; 0: not due
    uint64_t pending = 0;           // stored changes, those being sent included
    bool held = false;              // a person cancelled: what is pending waits for a new change
    std::optional<RunRecord> last;  // the last run that ended

    // Realtime tasks.
    bool whole_due = false;
    std::map<std::string, ChangeSet> gathered;  // by share
    std::optional<int64_t> gather_first;        // when the first of them came
    int64_t gather_last = 0;
    int64_t store_retry_at = 0;      // not before: the store could not be written
    std::optional<int64_t> poll_at;  // the next whole comparison of what cannot be watched
    std::map<std::string, std::string> notes;  // by share
    std::string store_note;
};

Service::Service(EventLoop& loop, const Clock& clock, Store& store, const DaemonConfig& config,
                 std::function<void()> on_change)
    : loop_(loop),
      clock_(clock),
      store_(store),
      config_(config),
      on_change_(std::move(on_change)),
      watcher_([this](const std::string& share, const std::string& path) { OnChange(share, path); },
               [this](const std::string& share, WatchLoss loss) { OnLoss(share, loss); }) {}

Service::~Service() {
    for (auto& [id, task] : tasks_) {
        if (task->active) {
            task->active->Cancel();
        }
    }
    for (auto& [id, task] : tasks_) {
        try {
            StoreGathered(*task);
            if (task->active) {
                task->ended = EndedRun{task->active->Plan().record, task->active->Plan().events};
                task->active.reset();
                RunRecord& record = task->ended->record;
                record.end = clock_.Now();
                record.result = ZEL::TASK_RESULT_FAILED;
                record.error = kStopped;
            }
            StoreEnd(*task);
        } catch (const std::exception& error) {
            // Opening the store the next time does the same.
            Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                           error.what());
        }
    }
}

void Service::Start() {
    for (TaskRecord& record : store_.Tasks()) {
        Task& task = Insert(std::move(record));
        task.pending = store_.CountEvents(task.record.ID());
    }
    for (RunRecord& run : store_.LastRuns()) {
        const auto found = tasks_.find(run.task_id);
        if (found == tasks_.end()) {
            continue;
        }
        // A run that failed, or that the daemon's own end cut off, is made up for.
        if (run.result == ZEL::TASK_RESULT_FAILED) {
            found->second->plan->Failed(Delays());
        }
        found->second->last = std::move(run);
    }
    loop_.OnReadable(watcher_.Fd(), [this] { RunWatcher(); });
    WatchShares();
    Advance();
}

RetryDelays Service::Delays() const {
    return {config_.retry_first.count(), config_.retry_max.count()};
}

void Service::SetConfig(const DaemonConfig& config) {
    config_ = config;
    Advance();
}

void Service::Refresh() {
    // What could not be watched in full is searched anew: the limit may have been raised.
    tzset();
    for (const auto& [id, task] : tasks_) {
        task->plan->ZoneChanged();
        for (const auto& [share, note] : task->notes) {
            watched_.erase(share);
        }
    }
    WatchShares();
    Advance();
}

// ---- What people ask for ----

Service::Task& Service::Get(const std::string& name) const {
    const auto found = by_name_.find(name);
    if (found == by_name_.end()) {
        throw RequestError(ZEL::RESULT_NO_ENTRY,
                           "there is no task '" + programs::Printable(name) + "'");
    }
    return *found->second;
}

void Service::CheckNameFree(const std::string& name, uint64_t id) const {
    const auto found = by_name_.find(name);
    if (found != by_name_.end() && found->second->record.ID() != id) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT,
                           "there is a task '" + programs::Printable(name) + "' already");
    }
}

Service::Task& Service::Insert(TaskRecord record) {
    auto task = std::make_unique<Task>(std::move(record), clock_);
    Task& inserted = *task;
    inserted.whole_due = inserted.record.IsRealtime();
    by_name_[inserted.record.Name()] = &inserted;
    tasks_[inserted.record.ID()] = std::move(task);
    return inserted;
}

// After its settings have changed: what was planned or learned with the old ones is void.
void Service::Reset(Task& task) {
    task.MakePlan(clock_);
    task.connection.reset();
    task.whole_due = task.record.IsRealtime();
    task.poll_at.reset();
    task.notes.clear();
    task.held = false;
    if (!task.record.IsRealtime()) {
        task.gathered.clear();
        task.gather_first.reset();
        store_.ClearEvents(task.record.ID());
        task.pending = 0;
    }
}

const TaskRecord& Service::Add(TaskRecord record) {
    CheckNameFree(record.Name(), 0);
    record.checked_until = clock_.Now();
    record.task.SetID(store_.AddTask(record));
    Task& task = Insert(std::move(record));
    WatchShares();
    Advance();
    return task.record;
}

const TaskRecord& Service::Edit(const std::string& name, TaskRecord record) {
    Task& task = Get(name);
    CheckNameFree(record.Name(), task.record.ID());
    if (task.active) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT,
                           "task '" + programs::Printable(name) +
                               "' is running: cancel it first, or wait until it has ended");
    }
    record.task.SetID(task.record.ID());
    record.checked_until = clock_.Now();
    store_.UpdateTask(record);
    by_name_.erase(name);
    task.record = std::move(record);
    by_name_[task.record.Name()] = &task;
    Reset(task);
    WatchShares();
    Advance();
    return task.record;
}

void Service::Remove(const std::string& name) {
    const uint64_t id = Get(name).record.ID();
    if (Get(name).active) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT,
                           "task '" + programs::Printable(name) + "' is running: cancel it first");
    }
    store_.RemoveTask(id);
    by_name_.erase(name);
    tasks_.erase(id);
    WatchShares();
    Advance();
}

uint64_t Service::RequestRun(const std::string& name) {
    Task& task = Get(name);
    task.requested = !task.active;
    const uint64_t after = task.last ? task.last->id : 0;
    Advance();
    return after;
}

void Service::Cancel(const std::string& name) {
    Task& task = Get(name);
    if (!task.active && task.due_since == 0 && !task.plan->RetryWaiting()) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT, "task '" + programs::Printable(name) +
                                                           "' neither runs nor waits to run");
    }
    task.requested = false;
    task.held = true;
    task.whole_due = task.whole_due || (task.record.IsRealtime() && task.plan->RetryWaiting());
    task.plan->Settled();
    if (task.plan->ScheduleDue()) {
        task.plan->ScheduleTaken();
        task.record.checked_until = task.plan->CheckedUntil();
        store_.UpdateTask(task.record);
    }
    if (task.active) {
        task.by_person = true;
        task.active->Cancel();
    }
    Advance();
}

void Service::SetPaused(const std::string& name, bool paused) {
    Task& task = Get(name);
    if (task.record.paused == paused) {
        return;
    }
    TaskRecord changed = task.record;
    changed.paused = paused;
    // What fell due during the pause was not missed but not wanted.
    changed.checked_until = clock_.Now();
    store_.UpdateTask(changed);
    task.record = std::move(changed);
    task.MakePlan(clock_);
    task.whole_due = task.record.IsRealtime();
    task.held = false;
    task.notes.clear();
    task.poll_at.reset();
    WatchShares();
    Advance();
}

const TaskRecord& Service::Find(const std::string& name) const {
    return Get(name).record;
}

std::vector<const TaskRecord*> Service::Tasks() const {
    std::vector<const TaskRecord*> records;
    records.reserve(by_name_.size());
    for (const auto& [name, task] : by_name_) {
        records.push_back(&task->record);
    }
    return records;
}

TaskState Service::StateOf(const TaskRecord& record) const {
    const Task& task = *tasks_.at(record.ID());
    TaskState state;
    state.status = task.active           ? ZEL::TASK_STATUS_RUNNING
                   : task.due_since != 0 ? ZEL::TASK_STATUS_WAITING
                   : task.record.paused  ? ZEL::TASK_STATUS_PAUSED
                                         : ZEL::TASK_STATUS_IDLE;
    if (!record.paused) {
        state.next_run = task.plan->NextRun();
    }
    if (const auto wait = task.plan->UntilRetry()) {
        state.retry_in = (*wait + 999) / 1000;
    }
    state.pending = task.pending;
    state.note = task.store_note;
    for (const auto& [share, note] : task.notes) {
        state.note += (state.note.empty() ? "" : "; ") + note;
    }
    state.active = task.active.get();
    state.last = task.last ? &*task.last : nullptr;
    return state;
}

std::vector<RunRecord> Service::Runs(const std::string& name, unsigned int limit) {
    return store_.Runs(Get(name).record.ID(), limit);
}

ServiceStats Service::Stats() const {
    ServiceStats stats;
    stats.tasks = tasks_.size();
    stats.running = static_cast<size_t>(std::count_if(
        tasks_.begin(), tasks_.end(), [](const auto& entry) { return !!entry.second->active; }));
    stats.workers = config_.workers;
    stats.watched = watcher_.Stats();
    return stats;
}

// ---- Changes on disk ----

// Makes the watcher watch what the realtime tasks need, where it is now.
void Service::WatchShares() {
    std::map<std::string, std::string> needed;
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches()) {
            continue;
        }
        for (const std::string& share : task->record.Info().GetShareList()) {
            ZEL::ShareInfo facts;
            if (needed.count(share) == 0 && ZEL::GetShareInfo(share, facts) == 0) {
                needed[share] = facts.GetModulePath();
            }
        }
    }
    for (const auto& [share, folder] : watched_) {
        if (needed.count(share) == 0) {
            watcher_.Remove(share);
        }
    }
    for (const auto& [share, folder] : needed) {
        const auto before = watched_.find(share);
        if (before == watched_.end() || before->second != folder) {
            watcher_.Add(share, folder);
            for (const auto& [id, task] : tasks_) {
                if (task->HasShare(share)) {
                    task->whole_due = task->Watches();
                    task->notes.erase(share);
                }
            }
        }
    }
    watched_ = std::move(needed);
    PostWatcher();
}

// A share that could not be watched, because its folder was away, may be there again.
void Service::WatchAgain(const Task& task) {
    const std::list<std::string>& shares = task.record.Info().GetShareList();
    if (task.Watches() &&
        std::any_of(shares.begin(), shares.end(),
                    [this](const std::string& share) { return watched_.count(share) == 0; })) {
        WatchShares();
    }
}

void Service::PostWatcher() {
    if (!watcher_posted_) {
        watcher_posted_ = true;
        loop_.Post([this] {
            watcher_posted_ = false;
            RunWatcher();
        });
    }
}

void Service::RunWatcher() {
    if (watcher_.Work(kWatcherSlice)) {
        PostWatcher();
    }
    Advance();
}

bool Service::IsSearching(const Task& task) const {
    const std::list<std::string>& shares = task.record.Info().GetShareList();
    return std::any_of(shares.begin(), shares.end(), [this](const std::string& share) {
        return watcher_.Stats(share).searching;
    });
}

void Service::OnChange(const std::string& share, const std::string& path) {
    const int64_t now = clock_.Elapsed();
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches() || !task->HasShare(share)) {
            continue;
        }
        task->gathered[share].Add(path);
        task->gather_first = task->gather_first.value_or(now);
        task->gather_last = now;
        task->held = false;
    }
}

void Service::OnLoss(const std::string& share, WatchLoss loss) {
    const std::string shown = "share '" + programs::Printable(share) + "': ";
    const std::string often = "; it is compared whole every " +
                              programs::HumanDuration(static_cast<uint64_t>(config_.poll.count()));
    std::string note;
    switch (loss) {
        case WatchLoss::kOverflow:
            break;  // searched anew, and compared whole once
        case WatchLoss::kWatchLimit:
            note = shown +
                   "not all of its folders can be watched (raise fs.inotify.max_user_watches)" +
                   often;
            break;
        case WatchLoss::kUnreadable:
            note = shown + "some of its folders cannot be read, and are not watched" + often;
            break;
        case WatchLoss::kFolderGone:
            note = shown + "its folder has gone; nothing is deleted at the server" + often;
            watched_.erase(share);
            break;
    }
    Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                   note.empty() ? (shown + "too many changes at once; it is compared whole").c_str()
                                : note.c_str());
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches() || !task->HasShare(share)) {
            continue;
        }
        task->whole_due = true;
        task->held = false;
        if (!note.empty()) {
            task->notes[share] = note;
            task->poll_at = clock_.Elapsed() + config_.poll.count() * 1000;
        }
    }
}

// What could not be watched may be watched since: a folder was made readable, a share came back.
void Service::ForgetSettledNotes(Task& task) {
    for (auto note = task.notes.begin(); note != task.notes.end();) {
        const bool settled =
            watched_.count(note->first) != 0 && watcher_.Stats(note->first).complete;
        note = settled ? task.notes.erase(note) : std::next(note);
    }
    if (task.notes.empty()) {
        task.poll_at.reset();
    }
}

bool Service::GatherDue(const Task& task, int64_t now) const {
    return task.HasGathered() && now >= task.store_retry_at &&
           (now - task.gather_last >= config_.gather.count() ||
            now - *task.gather_first >= config_.gather_max.count());
}

void Service::StoreGathered(Task& task) {
    for (auto& [share, changes] : task.gathered) {
        const std::vector<std::string> paths = changes.Take();
        try {
            store_.AddEvents(task.record.ID(), share, paths);
        } catch (const StoreError&) {
            for (const std::string& path : paths) {
                changes.Add(path);
            }
            throw;
        }
    }
    task.gathered.clear();
    task.gather_first.reset();
    task.store_note.clear();
    task.pending = store_.CountEvents(task.record.ID());
}

// ---- Runs ----

// Takes every step that is due, and sleeps until the next one is. Called after whatever happened.
void Service::Advance() {
    const int64_t now = clock_.Elapsed();
    std::vector<std::pair<Task*, Due>> due;
    for (const auto& [id, task] : tasks_) {
        try {
            if (task->ended && now >= task->store_retry_at) {
                StoreEnd(*task);
            }
            if (GatherDue(*task, now)) {
                StoreGathered(*task);
            }
        } catch (const StoreError& error) {
            StoreFailed(*task, error);
        }
        const std::optional<Due> what = task->active ? std::nullopt : WhatIsDue(*task);
        if (!what) {
            task->due_since = 0;
            continue;
        }
        if (task->due_since == 0) {
            task->due_since = now;
        }
        due.emplace_back(task.get(), *what);
    }
    std::stable_sort(due.begin(), due.end(), [](const auto& a, const auto& b) {
        return a.first->due_since < b.first->due_since;
    });
    for (const auto& [task, what] : due) {
        WatchAgain(*task);
        if (MayStart(*task)) {
            StartRun(*task, what);
        }
    }
    SetAlarm();
    on_change_();
}

std::optional<Service::Due> Service::WhatIsDue(Task& task) {
    if (task.ended || clock_.Elapsed() < task.store_retry_at) {
        return std::nullopt;
    }
    if (task.requested) {
        return Due{RunReason::kRequest, true};
    }
    if (task.record.paused) {
        return std::nullopt;
    }
    if (task.plan->ScheduleDue()) {
        return Due{RunReason::kSchedule, true};
    }
    if (task.plan->RetryWaiting()) {
        if (!task.plan->RetryDue()) {
            return std::nullopt;
        }
        return Due{RunReason::kRetry, !task.record.IsRealtime() || task.whole_due};
    }
    if (!task.record.IsRealtime() || task.held) {
        return std::nullopt;
    }
    const bool poll_due = task.poll_at && clock_.Elapsed() >= *task.poll_at;
    if (task.whole_due || poll_due || task.pending > 0) {
        return Due{RunReason::kChange, task.whole_due || poll_due};
    }
    return std::nullopt;
}

// Whether a due task can start now: a worker is free, no other run has one of its shares, and its
// folders have been found, so that no change falls between the comparison and the watch.
bool Service::MayStart(const Task& task) const {
    unsigned int running = 0;
    for (const auto& entry : tasks_) {
        const Task& other = *entry.second;
        if (!other.active) {
            continue;
        }
        ++running;
        const std::list<std::string>& shares = task.record.Info().GetShareList();
        if (std::any_of(shares.begin(), shares.end(),
                        [&](const std::string& share) { return other.HasShare(share); })) {
            return false;
        }
    }
    return running < config_.workers && !(task.Watches() && IsSearching(task));
}

void Service::FillOrder(Task& task, const Due& due, RunPlan& plan) {
    plan.order.task = task.record.Name();
    plan.order.task_id = task.record.ID();
    plan.order.excludes = task.record.excludes;
    plan.order.announce = due.whole;
    plan.whole = due.whole;
    std::map<std::string, ChangeSet> changes;
    for (const ZEL::Event& event : store_.PendingEvents(task.record.ID())) {
        plan.events.push_back(event.GetID());
        changes[event.GetShareName()].Add(event.GetRelativePath());
    }
    for (const std::string& share : task.record.Info().GetShareList()) {
        if (due.whole) {
            plan.order.shares.push_back({share, {"/"}});
        } else if (!changes[share].Empty()) {
            plan.order.shares.push_back({share, changes[share].Take()});
        }
    }
}

void Service::StartRun(Task& task, const Due& due) {
    RunPlan plan;
    try {
        if (task.HasGathered()) {
            StoreGathered(task);
        }
        FillOrder(task, due, plan);
        if (plan.order.shares.empty()) {
            // Changes of shares that are no longer the task's.
            store_.RemoveEvents(plan.events);
            task.pending = store_.CountEvents(task.record.ID());
            task.plan->Settled();
            task.due_since = 0;
            return;
        }
        if (task.plan->ScheduleDue()) {
            task.plan->ScheduleTaken();
            task.record.checked_until = task.plan->CheckedUntil();
            store_.UpdateTask(task.record);
        }
        store_.MarkSending(plan.events);
        plan.record.task_id = task.record.ID();
        plan.record.reason = due.reason;
        plan.record.start = clock_.Now();
        plan.record.id = store_.BeginRun(task.record.ID(), due.reason, plan.record.start);
    } catch (const StoreError& error) {
        StoreFailed(task, error);
        return;
    }
    task.requested = false;
    task.by_person = false;
    task.due_since = 0;
    if (due.whole) {
        // What changes from here on is told by events of its own.
        task.whole_due = false;
        ForgetSettledNotes(task);
        if (task.poll_at) {
            task.poll_at = clock_.Elapsed() + config_.poll.count() * 1000;
        }
    }
    if (!task.connection || !task.connection->Reusable(task.record.Info().GetShareList())) {
        task.connection = std::make_shared<Connection>(task.record.Info().GetSyncInfo());
    }
    Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] zel_daemon(%d): task '%s': run %llu starts\n",
                   __LINE__, task.record.Name().c_str(),
                   static_cast<unsigned long long>(plan.record.id));
    task.active = std::make_unique<ActiveRun>(
        loop_, task.connection, std::move(plan),
        [this, &task](const std::string& share, const TARQ::Backup::RunProgress& progress) {
            task.active->progress_share = share;
            task.active->progress = progress;
            on_change_();
        },
        [this, &task](const Verdict& verdict, const RunTotals& totals) {
            EndRun(task, verdict, totals);
        });
}

void Service::EndRun(Task& task, const Verdict& verdict, const RunTotals& totals) {
    const RunPlan plan = task.active->Plan();
    task.active.reset();
    RunRecord record = plan.record;
    record.end = clock_.Now();
    record.status = verdict.status;
    record.error = verdict.error;
    record.files_sent = totals.files_sent;
    record.files_deleted = totals.files_deleted;
    record.bytes_sent = totals.bytes_sent;
    record.rsync_runs = totals.rsync_runs;
    record.result = verdict.Ok()     ? ZEL::TASK_RESULT_SUCCESS
                    : task.by_person ? ZEL::TASK_RESULT_CANCELLED
                                     : ZEL::TASK_RESULT_FAILED;
    if (!verdict.Ok() && plan.whole && task.record.IsRealtime()) {
        task.whole_due = true;
    }
    if (record.result == ZEL::TASK_RESULT_FAILED) {
        task.plan->Failed(Delays());
        task.connection.reset();
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): task '%s': %s\n", __LINE__,
                       task.record.Name().c_str(), record.error.c_str());
    } else {
        task.plan->Settled();
    }
    task.last = record;
    task.ended = EndedRun{std::move(record), plan.events};
    try {
        StoreEnd(task);
    } catch (const StoreError& error) {
        StoreFailed(task, error);
    }
    Advance();
}

// Nothing of the task is run before this has been done: what was being sent would be left out.
void Service::StoreEnd(Task& task) {
    if (!task.ended) {
        return;
    }
    if (task.ended->record.result == ZEL::TASK_RESULT_SUCCESS) {
        store_.RemoveEvents(task.ended->events);
    } else {
        store_.ReturnEvents(task.ended->events);
    }
    store_.EndRun(task.ended->record);
    task.ended.reset();
    task.store_note.clear();
    task.pending = store_.CountEvents(task.record.ID());
}

void Service::StoreFailed(Task& task, const StoreError& error) {
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): task '%s': %s\n", __LINE__,
                   task.record.Name().c_str(), error.what());
    task.store_note = error.what();
    task.store_retry_at = clock_.Elapsed() + kStoreRetryMs;
    task.due_since = 0;
}

// ---- Time ----

// Milliseconds until the task needs to be looked at again, if time alone can bring that about.
std::optional<int64_t> Service::UntilNextStep(const Task& task) const {
    std::optional<int64_t> wait;
    const int64_t now = clock_.Elapsed();
    const auto at = [&](int64_t moment) {
        const int64_t left = std::max<int64_t>(moment - now, 0);
        wait = std::min(wait.value_or(left), left);
    };
    if (task.HasGathered()) {
        at(std::max(std::min(task.gather_last + config_.gather.count(),
                             *task.gather_first + config_.gather_max.count()),
                    task.store_retry_at));
    }
    if (task.active || task.due_since != 0) {
        return wait;  // the end of a run, or of a search, is what it waits for
    }
    if (task.store_retry_at > now) {
        at(task.store_retry_at);
    }
    if (task.record.paused) {
        return wait;
    }
    if (const auto retry = task.plan->UntilRetry()) {
        at(now + *retry);
    }
    if (const auto next = task.plan->NextRun()) {
        at(now + std::min((*next - clock_.Now()) * 1000, kLongestWaitMs));
    }
    if (task.poll_at && !task.held) {
        at(*task.poll_at);
    }
    return wait;
}

void Service::SetAlarm() {
    std::optional<int64_t> wait;
    for (const auto& [id, task] : tasks_) {
        if (const auto left = UntilNextStep(*task)) {
            wait = std::min(wait.value_or(*left), *left);
        }
    }
    if (wait) {
        loop_.SetTimer(std::chrono::milliseconds(*wait), [this] { Advance(); });
    } else {
        loop_.ClearTimer();
    }
}

}  // namespace zel_daemon
