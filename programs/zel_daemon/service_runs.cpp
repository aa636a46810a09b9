// The service's runs: when a task is due, how its run begins, and how it ends.
#include <algorithm>
#include <utility>

#include "ZEL/log.h"
#include "programs/zel_daemon/service_task.h"

namespace zel_daemon {

namespace {

using programs::RunTotals;
using programs::Verdict;
using ZEL::Logger;

// A store that could not be written is tried again after so long.
constexpr int64_t kStoreRetryMs = 10000;
// A timer for something that is far off is set again now and then.
constexpr int64_t kLongestWaitMs = int64_t{24} * 3600 * 1000;

}  // namespace

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
        if (PollDue(*task)) {
            SearchAgain(*task);
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
    if (task.whole_due || task.pending > 0) {
        return Due{RunReason::kChange, task.whole_due};
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
        return wait;  // nothing is due before
    }
    if (task.record.paused) {
        return wait;
    }
    const std::optional<int64_t> retry = task.plan->UntilRetry();
    if (retry) {
        at(now + *retry);
    }
    if (const auto next = task.plan->NextRun()) {
        at(now + std::min((*next - clock_.Now()) * 1000, kLongestWaitMs));
    }
    if (task.poll_at && !task.held && !retry) {
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
