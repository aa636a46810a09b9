#include "programs/zel_daemon/service.h"

#include <algorithm>
#include <utility>

#include "ZEL/channel.h"
#include "ZEL/log.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/task_map.h"

namespace zel_daemon {

namespace {

using ZEL::Logger;

constexpr char kStopped[] = "the daemon was stopped; the next run completes the copy";

// A start has enough to do.
constexpr int64_t kGapsAtStart = 6;

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
      indexes_(store.Path().substr(0, store.Path().rfind('/') + 1) + "index"),
      config_(config),
      on_change_(std::move(on_change)),
      watcher_([this](const std::string& share, const std::string& path) { OnChange(share, path); },
               [this](const std::string& share, const std::string& from, const std::string& to) {
                   OnMove(share, from, to);
               },
               [this](const std::string& share, const WatchLoss& loss) { OnLoss(share, loss); }) {
    loop_.OnReadable(places_.Fd(), [this] {
        if (places_.Changed()) {
            WatchShares();
            Advance();
        }
    });
}

Service::~Service() {
    verify_.reset();
    search_.reset();
    for (const PreviewJob& job : previews_) {
        job.feed->Cancel();
    }
    previews_.clear();
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
    std::map<uint64_t, Questions> questions = store_.AllQuestions();
    std::map<uint64_t, CopyLedger::Files> files = store_.FilesOfCopies();
    std::map<uint64_t, Verification::Shares> verified = store_.AllVerifications();
    for (TaskRecord& record : store_.Tasks()) {
        Task& task = Insert(std::move(record));
        const uint64_t id = task.machine.Record().ID();
        const auto run = last.find(id);
        task.pending = store_.CountEvents(id);
        task.machine.Restored(task.pending > 0,
                              run != last.end() ? std::optional(run->second) : std::nullopt,
                              std::move(questions[id]), files[id]);
        task.verification.Restore(std::move(verified[id]));
    }
    verify_at_ = clock_.Elapsed() + kGapsAtStart * config_.verify_gap.count();
    DropLeftIndexes();
    WatchShares();
    Advance();
}

void Service::SetConfig(const DaemonConfig& config) {
    config_ = config;
    verify_at_ = std::min(verify_at_, clock_.Elapsed() + config_.verify_gap.count());
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
    SetVerification(task, false);
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
    DropIndexes(id);  // its stored changes are forgotten
    const bool other_copies = !programs::SameAccount(task.machine.Record().ToMap(), record.ToMap());
    store_.ResetTask(record, other_copies);
    by_name_.erase(name);
    by_name_[record.Name()] = &task;
    task.machine.Edited(std::move(record));
    SetVerification(task, other_copies);
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
    if (verify_ && verify_->Order().task_id == id) {
        verify_->Cancel();
    }
    DropIndexes(id);
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

uint64_t Service::Confirm(const std::string& name) {
    TaskMachine& machine = Get(name).machine;
    if (!machine.Confirmed()) {
        throw RequestError(ZEL::RESULT_EVENT_CONFLICT, "task '" + programs::Printable(name) +
                                                           "' asks nothing: there is nothing to "
                                                           "confirm");
    }
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

std::shared_ptr<PreviewFeed> Service::Preview(
    const std::string& name, const std::optional<std::vector<programs::ShareOrder>>& verified) {
    const TaskRecord& record = Get(name).machine.Record();
    programs::RunOrder order;
    order.task = record.Name();
    order.task_id = record.ID();
    order.excludes = record.ExcludeRules();
    order.by_content = verified.has_value();
    for (const std::string& share : record.Info().GetShareList()) {
        order.shares.push_back({share});
    }
    if (verified && !verified->empty()) {
        order.shares = *verified;
    }
    auto feed = std::make_shared<PreviewFeed>([this] { loop_.Post([this] { Advance(); }); });
    previews_.push_back({clock_.Elapsed(), record.Info().GetSyncInfo(), std::move(order), feed});
    Advance();
    return feed;
}

void Service::SetPaused(const std::string& name, bool paused) {
    Task& task = Get(name);
    TaskRecord record = task.machine.Record();
    if (record.paused == paused) {
        return;
    }
    record.paused = paused;
    if (verify_ && verify_->Order().task_id == record.ID()) {
        verify_->Cancel();
    }
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
    state.status = machine.Running()           ? ZEL::TASK_STATUS_RUNNING
                   : machine.DueSince() != 0   ? ZEL::TASK_STATUS_WAITING
                   : record.paused             ? ZEL::TASK_STATUS_PAUSED
                   : !machine.Asking().empty() ? ZEL::TASK_STATUS_CONFIRM
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
    if (!machine.Asking().empty()) {
        for (const auto& [share, question] : machine.Asking()) {
            // The last run's error may say it already.
            if (!machine.Last() || machine.Last()->error.find(question.text) == std::string::npos) {
                AddPart(state.note, question.text);
            }
        }
        const std::string name = "'" + programs::Printable(record.Name()) + "'";
        AddPart(state.note, "zelctl task show " + name + " lists it, zelctl task confirm " + name +
                                " lets it go once");
    }
    state.asking = &machine.Asking();
    state.verified = &task.verification;
    state.verify_problem = task.verify_problem;
    if (const size_t damaged = task.verification.Damaged()) {
        const std::string name = "'" + programs::Printable(record.Name()) + "'";
        AddPart(state.note, programs::Count(damaged, "file") +
                                " with other bytes at the two ends under the same size and time: "
                                "zelctl task show " +
                                name + " lists them");
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
        watch.scanning =
            watch.scanning || stats.scanning || task.machine.ToSearch().count(name) != 0;
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
    stats.running += static_cast<size_t>(std::count_if(
        previews_.begin(), previews_.end(), [](const PreviewJob& job) { return !!job.run; }));
    stats.workers = config_.workers;
    for (const auto& [id, task] : tasks_) {
        stats.damaged += task.verification.Damaged();
    }
    stats.watched = watcher_.Stats();
    return stats;
}

}  // namespace zel_daemon
