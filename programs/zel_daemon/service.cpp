#include "programs/zel_daemon/service.h"

#include <algorithm>
#include <utility>

#include "ZEL/channel.h"
#include "ZEL/log.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/task_map.h"

namespace zel_daemon {

namespace {

using ZEL::Logger;

constexpr char kStopped[] = "the daemon was stopped; the next run completes the copy";

// Texts for people, one after the other.
void AddPart(std::string& text, const std::string& part) {
    text += (text.empty() || part.empty() ? "" : "; ") + part;
}

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
        if (task.active) {
            task.active->Cancel();
        }
    }
    for (auto& [id, task] : tasks_) {
        if (task.active) {
            task.active.reset();
            task.machine.Ended(programs::NothingDone(task.machine.Running()->order,
                                                     {programs::FailureKind::kLocal, 0, kStopped}),
                               {});
        }
        try {
            StoreChanges(task);
            StoreEnd(task);
        } catch (const std::exception& error) {
            // Opening the store the next time does the same.
            Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                           error.what());
        }
    }
}

void Service::Start() {
    std::map<uint64_t, RunRecord> last;
    for (RunRecord& run : store_.LastRuns()) {
        last[run.task_id] = std::move(run);
    }
    for (TaskRecord& record : store_.Tasks()) {
        Task& task = Insert(std::move(record));
        const uint64_t id = task.machine.Record().ID();
        const auto run = last.find(id);
        task.pending = store_.CountEvents(id);
        task.machine.Restored(task.pending > 0,
                              run != last.end() ? std::optional(run->second) : std::nullopt);
    }
    WatchShares();
    Advance();
}

void Service::SetConfig(const DaemonConfig& config) {
    config_ = config;
    Advance();
}

void Service::Refresh() {
    tzset();
    for (auto& [id, task] : tasks_) {
        task.machine.ZoneChanged();
    }
    for (auto& [name, share] : shares_) {
        if (!share.problem.empty()) {
            share.folder.clear();  // scanned anew: the limit may have been raised
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
    if (found != by_name_.end() && found->second->machine.Record().ID() != id) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT,
                           "there is a task '" + programs::Printable(name) + "' already");
    }
}

Service::Task& Service::Insert(TaskRecord record) {
    const uint64_t id = record.ID();
    Task& task =
        tasks_.emplace(id, Task{TaskMachine(std::move(record), clock_, config_)}).first->second;
    by_name_[task.machine.Record().Name()] = &task;
    return task;
}

const TaskRecord& Service::Add(TaskRecord record) {
    CheckNameFree(record.Name(), 0);
    record.checked_until = clock_.Now();
    record.task.SetID(store_.AddTask(record));
    Task& task = Insert(std::move(record));
    WatchShares();
    Advance();
    return task.machine.Record();
}

const TaskRecord& Service::Edit(const std::string& name, TaskRecord record) {
    Task& task = Get(name);
    const uint64_t id = task.machine.Record().ID();
    CheckNameFree(record.Name(), id);
    if (task.active) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT,
                           "task '" + programs::Printable(name) +
                               "' is running: cancel it first, or wait until it has ended");
    }
    record.task.SetID(id);
    record.checked_until = clock_.Now();
    store_.ResetTask(record);
    by_name_.erase(name);
    by_name_[record.Name()] = &task;
    task.machine.Edited(std::move(record));
    task.connection.reset();
    task.pending = 0;
    WatchShares();
    Advance();
    return task.machine.Record();
}

void Service::Remove(const std::string& name) {
    const Task& task = Get(name);
    if (task.active) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT,
                           "task '" + programs::Printable(name) + "' is running: cancel it first");
    }
    const uint64_t id = task.machine.Record().ID();
    store_.RemoveTask(id);
    by_name_.erase(name);
    tasks_.erase(id);
    WatchShares();
    Advance();
}

uint64_t Service::RequestRun(const std::string& name) {
    TaskMachine& machine = Get(name).machine;
    machine.Asked();
    const uint64_t after = machine.Last() ? machine.Last()->id : 0;
    Advance();
    return after;
}

void Service::Cancel(const std::string& name) {
    Task& task = Get(name);
    if (!task.machine.Cancelled()) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT, "task '" + programs::Printable(name) +
                                                           "' neither runs nor waits to run");
    }
    if (task.active) {
        task.active->Cancel();
    }
    Advance();
}

void Service::SetPaused(const std::string& name, bool paused) {
    Task& task = Get(name);
    TaskRecord record = task.machine.Record();
    if (record.paused == paused) {
        return;
    }
    record.paused = paused;
    // What fell due during the pause was not missed but not wanted.
    record.checked_until = clock_.Now();
    store_.UpdateTask(record);
    task.machine.PauseSet(std::move(record));
    WatchShares();
    Advance();
}

const TaskRecord& Service::Find(const std::string& name) const {
    return Get(name).machine.Record();
}

std::vector<const TaskRecord*> Service::Tasks() const {
    std::vector<const TaskRecord*> records;
    records.reserve(by_name_.size());
    for (const auto& [name, task] : by_name_) {
        records.push_back(&task->machine.Record());
    }
    return records;
}

TaskState Service::StateOf(const TaskRecord& record) const {
    const Task& task = tasks_.at(record.ID());
    const TaskMachine& machine = task.machine;
    TaskState state;
    state.status = machine.Running()         ? ZEL::TASK_STATUS_RUNNING
                   : machine.DueSince() != 0 ? ZEL::TASK_STATUS_WAITING
                   : record.paused           ? ZEL::TASK_STATUS_PAUSED
                                             : ZEL::TASK_STATUS_IDLE;
    state.next_run = machine.NextRun();
    if (const auto wait = machine.UntilRetry()) {
        state.retry_in = (*wait + 999) / 1000;
    }
    state.pending = task.pending;
    AddPart(state.note, machine.StoreProblem());
    for (const std::string& share : machine.Unwatched()) {
        AddPart(state.note, shares_.at(share).problem);
    }
    AddPart(state.note, machine.WaitsFor());
    state.watch = WatchOf(task);
    state.run = machine.Running() ? machine.Running()->record.id : 0;
    state.active = task.active.get();
    state.last = machine.Last() ? &*machine.Last() : nullptr;
    return state;
}

std::optional<TaskWatch> Service::WatchOf(const Task& task) const {
    if (!task.machine.Watches()) {
        return std::nullopt;
    }
    TaskWatch watch;
    for (const std::string& name : task.machine.Record().Info().GetShareList()) {
        const WatchedShare& share = shares_.at(name);
        const WatchStats stats = watcher_.Stats(name);
        watch.folders += stats.folders;
        watch.scanning = watch.scanning || stats.scanning;
        if (IsCovered(name) && (stats.folders > 0 || stats.scanning)) {
            continue;
        }
        watch.complete = false;
        AddPart(watch.problem, share.problem.empty() ? "share '" + programs::Printable(name) +
                                                           "': its folder is not watched"
                                                     : share.problem);
    }
    return watch;
}

std::vector<RunRecord> Service::Runs(const std::string& name, unsigned int limit) {
    return store_.Runs(Get(name).machine.Record().ID(), limit);
}

ServiceStats Service::Stats() const {
    ServiceStats stats;
    stats.tasks = tasks_.size();
    stats.running = static_cast<size_t>(std::count_if(
        tasks_.begin(), tasks_.end(), [](const auto& entry) { return !!entry.second.active; }));
    stats.workers = config_.workers;
    stats.watched = watcher_.Stats();
    return stats;
}

}  // namespace zel_daemon
