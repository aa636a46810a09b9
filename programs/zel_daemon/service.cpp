#include "programs/zel_daemon/service.h"

#include <utility>

#include "ZEL/channel.h"
#include "ZEL/log.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service_task.h"
#include "programs/zel_daemon/task_map.h"

namespace zel_daemon {

namespace {

using ZEL::Logger;

constexpr char kStopped[] = "the daemon was stopped; the next run completes the copy";

}  // namespace

Service::Service(EventLoop& loop, const Clock& clock, Store& store, const DaemonConfig& config,
                 std::function<void()> on_change)
    : loop_(loop),
      clock_(clock),
      store_(store),
      config_(config),
      on_change_(std::move(on_change)),
      watcher_([this](const std::string& share, const std::string& path) { OnChange(share, path); },
               [this](const std::string& share, const WatchLoss& loss) { OnLoss(share, loss); }) {}

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
                task->ended = EndedRun{task->active->Plan().record, {}, {}};
                for (const ZEL::Event& event : task->active->Plan().events) {
                    task->ended->unsent.push_back(event.GetID());
                }
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
        if (task.pending > 0 && task.record.IsRealtime()) {
            for (const std::string& share : task.record.Info().GetShareList()) {
                task.debts.OweChanges(share);
            }
        }
    }
    for (RunRecord& run : store_.LastRuns()) {
        const auto found = tasks_.find(run.task_id);
        if (found == tasks_.end()) {
            continue;
        }
        // A run that failed, or that the daemon's own end cut off, is made up for.
        if (run.result == ZEL::TASK_RESULT_FAILED) {
            found->second->plan->Failed(Delays());
            found->second->debts.OweAllWhole();
        }
        found->second->last = std::move(run);
    }
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
    if (inserted.record.IsRealtime()) {
        inserted.debts.OweAllWhole();
    }
    by_name_[inserted.record.Name()] = &inserted;
    tasks_[inserted.record.ID()] = std::move(task);
    return inserted;
}

// After its settings have changed: what was planned or learned with the old ones is void.
void Service::Reset(Task& task) {
    task.MakePlan(clock_);
    task.connection.reset();
    task.debts.SetShares(task.record.Info().GetShareList());
    task.poll_at.reset();
    task.notes.clear();
    task.held = false;
    task.gathered.clear();
    task.gather_first.reset();
    if (task.record.IsRealtime()) {
        task.debts.OweAllWhole();  // which has the changes in it that waited
    }
    store_.ClearEvents(task.record.ID());
    task.pending = 0;
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
    if (!task.active && task.due_since == 0 && !task.plan->RetryWaiting() &&
        !task.debts.NextRetry()) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT, "task '" + programs::Printable(name) +
                                                           "' neither runs nor waits to run");
    }
    task.requested = false;
    task.held = true;
    task.plan->Settled();
    if (task.record.IsRealtime()) {
        task.debts.Release();
    } else {
        task.debts.Forgive();
    }
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
    if (task.record.IsRealtime()) {
        task.debts.Release();
        task.debts.OweAllWhole();
    } else {
        task.debts.Forgive();
    }
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
    if (const auto wait = UntilRetry(task)) {
        state.retry_in = (*wait + 999) / 1000;
    }
    state.pending = task.pending;
    state.note = task.store_note;
    for (const auto& [share, note] : task.notes) {
        state.note += (state.note.empty() ? "" : "; ") + note;
    }
    const std::string waits_for = WaitsFor(task);
    if (!waits_for.empty()) {
        state.note += (state.note.empty() ? "" : "; ") + waits_for;
    }
    state.watch = WatchOf(task);
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

}  // namespace zel_daemon
