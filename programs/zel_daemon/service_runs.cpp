// The service's steps: what its tasks want done, and which of them run.
#include <algorithm>
#include <utility>

#include "ZEL/log.h"
#include "base/text.h"
#include "programs/common/host.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service.h"

namespace zel_daemon {

namespace {

using programs::Printable;
using ZEL::Logger;

// After a sign that something has come back.
constexpr int64_t kSettleMs = 1000;
// Servers that have a worker each though all others are taken.
constexpr unsigned int kMoreServers = 32;

void TakeSooner(std::optional<int64_t>& soonest, std::optional<int64_t> wait) {
    if (wait && (!soonest || *wait < *soonest)) {
        soonest = wait;
    }
}

// People write a name in any case.
std::string ServerKey(const ZEL::SyncInfo& info) {
    return base::Lower(programs::ServerOf(info));
}

std::vector<uint64_t> IdsOf(const std::vector<ZEL::Event>& events) {
    std::vector<uint64_t> ids;
    ids.reserve(events.size());
    for (const ZEL::Event& event : events) {
        ids.push_back(event.GetID());
    }
    return ids;
}

}  // namespace

// Does all that is due, and sleeps until there is more. Called after whatever happened.
void Service::Advance() {
    const int64_t now = clock_.Elapsed();
    std::optional<int64_t> wait;
    if (!recovered_.empty() && now >= look_at_) {
        HastenRetries();
    } else if (!recovered_.empty()) {
        wait = look_at_ - now;
    }
    SearchSome();
    previews_.remove_if([](const PreviewJob& job) { return !job.run && job.feed->Cancelled(); });
    std::vector<Due> due;
    Room room;
    for (PreviewJob& job : previews_) {
        if (job.run) {
            TakeWorker(job.info, room);
        } else {
            due.push_back({job.since, nullptr, {}, &job});
        }
    }
    for (auto& [id, task] : tasks_) {
        const Step step = DoChores(task);
        TakeRoom(task, room);
        if (step.kind == Step::Kind::kRun) {
            due.push_back({task.machine.DueSince(), &task, step, nullptr});
        } else {
            TakeSooner(wait, step.wait);
        }
    }
    std::stable_sort(due.begin(), due.end(),
                     [](const Due& a, const Due& b) { return a.since < b.since; });
    bool others_wait = false;
    for (auto& [since, task, step, preview] : due) {
        if (preview != nullptr) {
            if (HasWorker(preview->info, room)) {
                TakeWorker(preview->info, room);
                StartPreview(*preview);
            } else {
                others_wait = true;
            }
            continue;
        }
        WatchAgain(*task);
        while (step.kind == Step::Kind::kRun && MayStart(*task, step, room)) {
            StartRun(*task, step);
            TakeRoom(*task, room);
            step = DoChores(*task);
        }
        others_wait = others_wait || step.kind == Step::Kind::kRun;
        TakeSooner(wait, step.wait);
    }
    VerifySome(others_wait, wait);
    if (wait) {
        loop_.SetTimer(std::chrono::milliseconds(*wait), [this] { Advance(); });
    } else {
        loop_.ClearTimer();
    }
    on_change_();
}

// Does what is due of a task but its run, and returns what is to be done then.
Step Service::DoChores(Task& task) {
    for (;;) {
        const Step step = task.machine.NextStep();
        try {
            switch (step.kind) {
                case Step::Kind::kStoreEnd:
                    StoreEnd(task);
                    break;
                case Step::Kind::kStoreRecord:
                    store_.UpdateTask(task.machine.Record());
                    task.machine.RecordStored();
                    break;
                case Step::Kind::kStoreChanges:
                    StoreChanges(task);
                    break;
                case Step::Kind::kRescan:
                    Rescan(task);
                    break;
                case Step::Kind::kRun:
                case Step::Kind::kWait:
                    return step;
            }
        } catch (const programs::Failure& failure) {
            StoreFailed(task, failure);
        }
    }
}

void Service::StoreEnd(Task& task) {
    if (const std::optional<RunEnd>& end = task.machine.End()) {
        store_.EndRun(*task.machine.Last(), *end);
        task.machine.EndStored();
        task.pending = store_.CountEvents(task.machine.Record().ID());
    }
}

void Service::StoreChanges(Task& task) {
    if (task.machine.HasDebounced()) {
        const uint64_t id = task.machine.Record().ID();
        for (const auto& [share, paths] : task.machine.DebouncedChanges()) {
            store_.AddEvents(id, share, paths, task.machine.DebouncedMoves(share));
        }
        task.machine.ChangesStored();
        task.pending = store_.CountEvents(id);
    }
}

void Service::StoreFailed(Task& task, const programs::Failure& failure) {
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): task '%s': %s\n", __LINE__,
                   Printable(task.machine.Record().Name()).c_str(), failure.what());
    task.machine.StoreFailed(failure.what());
}

// ---- Runs ----

void Service::TakeRoom(const Task& task, Room& room) const {
    if (const std::optional<RunPlan>& plan = task.machine.Running()) {
        TakeWorker(task.machine.Record().Info().GetSyncInfo(), room);
        for (const programs::ShareOrder& share : plan->order.shares) {
            room.in_use.insert(share.share);
        }
    }
}

void Service::TakeWorker(const ZEL::SyncInfo& info, Room& room) {
    ++room.running;
    room.servers.insert(ServerKey(info));
}

bool Service::HasWorker(const ZEL::SyncInfo& info, const Room& room) const {
    return room.running < config_.workers || (room.running < config_.workers + kMoreServers &&
                                              room.servers.count(ServerKey(info)) == 0);
}

// Whether a worker is free, no other run has one of the shares, and their folders have been found,
// so that no change falls between the resync and the watch.
bool Service::MayStart(const Task& task, const Step& step, const Room& room) const {
    return HasWorker(task.machine.Record().Info().GetSyncInfo(), room) &&
           !task.machine.AnyShare(step, [&](const std::string& share) {
               return room.in_use.count(share) != 0 ||
                      (task.machine.Watches() && watcher_.Stats(share).scanning);
           });
}

void Service::StartRun(Task& task, const Step& step) {
    const TaskRecord& record = task.machine.Record();
    std::optional<RunPlan> plan;
    try {
        StoreChanges(task);
        plan = task.machine.Begin(
            step,
            [&](const std::string& share, uint64_t after) {
                return store_.PendingEvents(record.ID(), share, after);
            },
            [&](const std::string& share) { return store_.Moves(record.ID(), share); });
        if (!plan) {
            return;
        }
        plan->record.id = store_.BeginRun(record.ID(), plan->record.reason, plan->record.start,
                                          IdsOf(plan->events));
    } catch (const programs::Failure& failure) {
        StoreFailed(task, failure);
        return;
    }
    if (plan->order.announce) {  // a resync: what changes from here on is notified of
        ForgetSettledProblems(task);
    }
    if (!task.connection || task.connection->cancel) {
        task.connection = std::make_shared<Connection>(record.Info().GetSyncInfo());
    }
    Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] zel_daemon(%d): task '%s': run %llu starts\n",
                   __LINE__, Printable(record.Name()).c_str(),
                   static_cast<unsigned long long>(plan->record.id));
    GiveWay(task);
    task.machine.Started(std::move(*plan));
    task.active = std::make_unique<ActiveRun>(
        loop_, task.connection, task.machine.Running()->order, IndexesOf(record), clock_.Now(),
        [this, &task](const std::string& share, const TARQ::Backup::RunProgress& progress) {
            task.active->progress_share = share;
            task.active->progress = progress;
            on_change_();
        },
        [this, &task](const ActiveRun::Outcome& outcome) { EndRun(task, outcome); });
}

void Service::EndRun(Task& task, const ActiveRun::Outcome& outcome) {
    const programs::RunResult& result = outcome.result;
    task.active.reset();
    ForgetReplaced(task, result);
    const std::list<std::string>& shares = task.machine.Record().Info().GetShareList();
    if (task.machine.Watches() &&
        std::any_of(shares.begin(), shares.end(), [this](const std::string& share) {
            return !shares_.at(share).folder.empty() && !IsAtItsPlace(share);
        })) {
        WatchShares();
    }
    const RunRecord& run = task.machine.Ended(result, outcome.totals);
    for (const auto& [share, path] : outcome.linked) {
        task.machine.Changed(share, path);
    }
    PostWatcher();  // what was moved while the run was under way may still be unheard
    if (run.result == ZEL::TASK_RESULT_FAILED) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): task '%s': %s\n", __LINE__,
                       Printable(task.machine.Record().Name()).c_str(),
                       Printable(programs::OneLine(run.error)).c_str());
    }
    if (result.failure && result.failure->reach == programs::Reach::kRun) {
        task.connection.reset();
    }
    Advance();
}

void Service::StartPreview(PreviewJob& job) {
    job.run = std::make_unique<PreviewRun>(
        loop_, job.feed, job.info, job.order,
        PreviewListener{
            job.order.by_content ? SendDifferences(job)
                                 : [](const std::string&, const TARQ::Backup::RunChange&) {},
            [this, &job] {
                if (job.order.by_content) {
                    NoteVerified(job.order, job.damaged);
                }
            },
            [this, &job] {
                previews_.remove_if([&](const PreviewJob& other) { return &other == &job; });
                Advance();
            }});
}

// ---- What has come back ----

void Service::MayHaveRecovered(Recovery what) {
    // One change seldom comes alone: an address is there before the way to the server is.
    if (recovered_.empty()) {
        look_at_ = clock_.Elapsed() + kSettleMs;
    }
    recovered_.insert(what);
    Advance();
}

void Service::HastenRetries() {
    const std::set<Recovery> recovered = std::exchange(recovered_, {});
    if (recovered.count(Recovery::kSettings) != 0 || recovered.count(Recovery::kVolume) != 0) {
        WatchShares();
    }
    for (auto& [id, task] : tasks_) {
        task.machine.Recovered(recovered, [](const std::string& share) {
            return programs::ShareProblem(share).empty();
        });
    }
}

}  // namespace zel_daemon
