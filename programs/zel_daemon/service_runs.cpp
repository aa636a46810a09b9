// The service's runs: when a task is due, how its run begins, and how it ends.
#include <algorithm>
#include <set>
#include <utility>

#include "ZEL/log.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service_task.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using programs::Reach;
using programs::RunFailure;
using programs::RunResult;
using programs::RunTotals;
using ZEL::Logger;

// A store that could not be written is tried again after so long.
constexpr int64_t kStoreRetryMs = 10000;
// A timer for something that is far off is set again now and then.
constexpr int64_t kLongestWaitMs = int64_t{24} * 3600 * 1000;
// What failed and changes again is tried so often at most.
constexpr int64_t kChangedAgainMs = 60000;
// After a sign that something has come back.
constexpr int64_t kSettleMs = 1000;

std::vector<uint64_t> IdsOf(const std::vector<ZEL::Event>& events) {
    std::vector<uint64_t> ids;
    ids.reserve(events.size());
    for (const ZEL::Event& event : events) {
        ids.push_back(event.GetID());
    }
    return ids;
}

// A receiver that died in a copy has left what it had of a file beside it, under another name.
bool BrokeOff(const RunFailure& verdict) {
    return verdict.reach == Reach::kShare &&
           (verdict.status == TARQ::Backup::STATUS_SOCKET ||
            verdict.status == TARQ::Backup::STATUS_PROTOCOL_STREAM ||
            verdict.status == TARQ::Backup::STATUS_TIMEOUT);
}

}  // namespace

// Takes every step that is due, and sleeps until the next one is. Called after whatever happened.
void Service::Advance() {
    const int64_t now = clock_.Elapsed();
    if (!recovered_.empty() && now >= look_at_) {
        HastenRetries();
    }
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
        if (MayStart(*task, what)) {
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
    const bool again = task.plan->RetryWaiting();
    if ((again && !task.plan->RetryDue()) || (task.held && task.record.IsRealtime())) {
        return std::nullopt;
    }
    const std::optional<int64_t> next = task.debts.Next();
    if (next && *next <= clock_.Elapsed()) {
        return Due{again ? RunReason::kRetry : RunReason::kChange, false};
    }
    return std::nullopt;
}

// Whether a due task can start now: a worker is free, no other run has one of its shares, and its
// folders have been found, so that no change falls between the comparison and the watch.
bool Service::MayStart(const Task& task, const Due& due) const {
    std::set<std::string> in_use;
    unsigned int running = 0;
    for (const auto& entry : tasks_) {
        if (entry.second->active) {
            ++running;
            for (const programs::ShareOrder& share : entry.second->active->Plan().order.shares) {
                in_use.insert(share.share);
            }
        }
    }
    if (running >= config_.workers) {
        return false;
    }
    const auto hindered = [&](const std::string& share) {
        return in_use.count(share) != 0 || (task.Watches() && watcher_.Stats(share).searching);
    };
    const std::list<std::string>& shares = task.record.Info().GetShareList();
    return due.all ? std::none_of(shares.begin(), shares.end(), hindered)
                   : !task.debts.AnyDue(clock_.Elapsed(), hindered);
}

// Takes what may be tried now. Whether some of it has failed before.
bool Service::FillOrder(Task& task, RunPlan& plan) {
    bool again = false;
    plan.order.task = task.record.Name();
    plan.order.task_id = task.record.ID();
    plan.order.excludes = task.record.excludes;
    plan.order.announce = false;
    for (const ShareDebts::Due& due : task.debts.Take(clock_.Elapsed())) {
        ChangeSet changes;
        if (due.stored) {
            for (ZEL::Event& event : store_.PendingEvents(task.record.ID(), due.share, due.after)) {
                changes.Add(event.GetRelativePath());
                plan.events.push_back(std::move(event));
            }
        }
        if (due.whole) {
            plan.order.shares.push_back({due.share, {"/"}, false});
            plan.order.announce = true;
        } else if (!changes.Empty()) {
            plan.order.shares.push_back({due.share, changes.Take(), due.rest_waits});
        } else if (due.rest_waits) {
            // What changed is what has failed before: that may have mended it.
            task.debts.Hasten(
                clock_.Elapsed(), kChangedAgainMs,
                [&](const std::string& share, programs::Trouble) { return share == due.share; });
        }
        again = again || due.again;
    }
    return again;
}

void Service::StartRun(Task& task, const Due& due) {
    RunPlan plan;
    try {
        if (task.HasGathered()) {
            StoreGathered(task);
        }
        if (due.all) {
            task.debts.Release();
            task.debts.OweAllWhole();
        }
        const bool again = FillOrder(task, plan);
        if (plan.order.shares.empty()) {
            task.debts.Settle(clock_.Elapsed(), {}, Delays(), 0);
            task.plan->Settled();
            task.due_since = 0;
            return;
        }
        if (task.plan->ScheduleDue()) {
            task.plan->ScheduleTaken();
            task.record.checked_until = task.plan->CheckedUntil();
            store_.UpdateTask(task.record);
        }
        store_.MarkSending(IdsOf(plan.events));
        plan.record.task_id = task.record.ID();
        plan.record.reason =
            again && due.reason == RunReason::kChange ? RunReason::kRetry : due.reason;
        plan.record.start = clock_.Now();
        plan.record.id = store_.BeginRun(task.record.ID(), plan.record.reason, plan.record.start);
    } catch (const StoreError& error) {
        PutBack(task);
        StoreFailed(task, error);
        return;
    }
    task.requested = false;
    task.by_person = false;
    task.due_since = 0;
    if (plan.order.announce) {  // whole shares: what changes from here on is told by events
        ForgetSettledNotes(task);
        if (task.poll_at) {
            task.poll_at = clock_.Elapsed() + config_.poll.count() * 1000;
        }
    }
    if (!task.connection || task.connection->cancel) {
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
        [this, &task](const RunResult& result, const RunTotals& totals) {
            EndRun(task, result, totals);
        });
}

void Service::EndRun(Task& task, const RunResult& result, const RunTotals& totals) {
    const RunPlan plan = task.active->Plan();
    task.active.reset();
    const RunFailure& verdict = result.verdict;
    RunRecord record = plan.record;
    record.end = clock_.Now();
    record.status = verdict.status;
    record.error = verdict.error;
    record.details = verdict.details;
    record.files_sent = totals.files_sent;
    record.files_deleted = totals.files_deleted;
    record.bytes_sent = totals.bytes_sent;
    record.rsync_runs = totals.rsync_runs;
    record.result = verdict.Ok()     ? ZEL::TASK_RESULT_SUCCESS
                    : task.by_person ? ZEL::TASK_RESULT_CANCELLED
                                     : ZEL::TASK_RESULT_FAILED;
    if (record.result == ZEL::TASK_RESULT_FAILED) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): task '%s': %s\n", __LINE__,
                       task.record.Name().c_str(), record.error.c_str());
    }
    if (record.result == ZEL::TASK_RESULT_FAILED && verdict.reach == Reach::kRun) {
        task.plan->Failed(Delays());
        task.connection.reset();
    } else {
        task.plan->Settled();
    }
    task.last = record;
    task.ended = EndedRun{std::move(record), {}, {}};
    Settle(task, plan, result);
    try {
        StoreEnd(task);
    } catch (const StoreError& error) {
        StoreFailed(task, error);
    }
    Advance();
}

// What the run has sent is forgotten, what it has not is owed.
void Service::Settle(Task& task, const RunPlan& plan, const RunResult& result) {
    std::map<std::string, std::vector<const std::string*>> unsent_paths;
    std::map<std::string, ShareDebts::Outcome> outcomes;
    for (const programs::Undone& undone : result.undone) {
        ShareDebts::Outcome& outcome = outcomes[undone.share];
        const bool other = undone.verdict.reach == Reach::kRun;
        if (!outcome.failed || undone.verdict.reach == Reach::kShare) {
            outcome.reach = undone.verdict.reach;
            outcome.trouble = undone.verdict.trouble;
        }
        outcome.failed = true;
        outcome.tried = outcome.tried && !other;
        outcome.broke_off = outcome.broke_off || BrokeOff(undone.verdict);
        for (const std::string& path : undone.paths) {
            unsent_paths[undone.share].push_back(&path);
        }
    }
    for (const ZEL::Event& event : plan.events) {
        const auto unsent = unsent_paths.find(event.GetShareName());
        const bool sent =
            unsent == unsent_paths.end() ||
            std::none_of(unsent->second.begin(), unsent->second.end(), [&](const auto* path) {
                return ChangeSet::Covers(*path, event.GetRelativePath());
            });
        (sent ? task.ended->sent : task.ended->unsent).push_back(event.GetID());
        if (!sent) {
            uint64_t& last = outcomes[event.GetShareName()].last_change;
            last = std::max(last, event.GetID());
        }
    }
    task.debts.Settle(clock_.Elapsed(), outcomes, Delays(), task.plan->Chance());
    if (task.by_person && !task.record.IsRealtime()) {
        task.debts.Forgive();
    }
}

void Service::MayHaveRecovered(Recovery what) {
    // One change seldom comes alone: an address is there before the way to the server is.
    if (recovered_.empty()) {
        look_at_ = clock_.Elapsed() + kSettleMs;
    }
    recovered_.insert(what);
    Advance();
}

// What failed for want of what may be there now does not wait any longer. A server that many ask
// because the network comes and goes is spared: between two tries lies the first wait.
void Service::HastenRetries() {
    const bool volume = recovered_.count(Recovery::kVolume) != 0;
    const bool network = recovered_.count(Recovery::kNetwork) != 0;
    const bool settings = recovered_.count(Recovery::kSettings) != 0;
    recovered_.clear();
    const int64_t now = clock_.Elapsed();
    const int64_t gap = config_.retry_first.count();
    if (settings || volume) {
        WatchShares();
    }
    for (const auto& [id, task] : tasks_) {
        if ((network || settings) && !task->active && task->plan->RetryWaiting()) {
            task->connection.reset();
            task->plan->Hasten(gap);
        }
        task->debts.Hasten(now, gap, [&](const std::string& share, programs::Trouble trouble) {
            if (trouble == programs::Trouble::kLocal) {
                return (volume || settings) && ShareProblem(share).empty();
            }
            return settings || (network && trouble == programs::Trouble::kFailed);
        });
    }
}

// A run that could not begin: all that was taken for it is owed as it was.
void Service::PutBack(Task& task) {
    std::map<std::string, ShareDebts::Outcome> outcomes;
    for (const std::string& share : task.record.Info().GetShareList()) {
        outcomes[share].tried = false;
    }
    task.debts.Settle(clock_.Elapsed(), outcomes, Delays(), 0);
}

// Nothing of the task is run before this has been done: what was being sent would be left out.
void Service::StoreEnd(Task& task) {
    if (!task.ended) {
        return;
    }
    store_.RemoveEvents(task.ended->sent);
    store_.ReturnEvents(task.ended->unsent);
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
    if (const auto next = task.plan->NextRun()) {
        at(now + std::min((*next - clock_.Now()) * 1000, kLongestWaitMs));
    }
    if (const auto retry = task.plan->UntilRetry()) {
        at(now + *retry);
        return wait;
    }
    if (task.held && task.record.IsRealtime()) {
        return wait;
    }
    if (task.poll_at) {
        at(*task.poll_at);
    }
    if (const auto next = task.debts.Next()) {
        at(*next);
    }
    return wait;
}

// Milliseconds until something that failed is tried again.
std::optional<int64_t> Service::UntilRetry(const Task& task) const {
    std::optional<int64_t> wait = task.plan->UntilRetry();
    const std::optional<int64_t> share = task.debts.NextRetry();
    if (!wait && share) {
        wait = std::max<int64_t>(*share - clock_.Elapsed(), 0);
    }
    return wait;
}

// What a person is told that the next try waits for.
std::string Service::WaitsFor(const Task& task) {
    if (task.plan->RetryWaiting()) {
        return "waits for its server; tried at once when the network changes";
    }
    const ShareDebts::Waiting waiting = task.debts.WhatWaits();
    if (waiting.shares == 0) {
        return "";
    }
    std::string words = "share '" + programs::Printable(waiting.first) + "'";
    if (waiting.shares > 1) {
        words += " and " + programs::Count(waiting.shares - 1, "other share") + " wait";
    } else {
        words += " waits";
    }
    switch (waiting.trouble) {
        case programs::Trouble::kLocal:
            return words + " for the volume or folder; tried at once when it is there";
        case programs::Trouble::kRefused:
            return words + " for the server to take it";
        case programs::Trouble::kBusy:
            return words + " until fewer files change while they are read";
        default:
            return words + " for the next try";
    }
}

void Service::SetAlarm() {
    std::optional<int64_t> wait;
    if (!recovered_.empty()) {
        wait = std::max<int64_t>(look_at_ - clock_.Elapsed(), 0);
    }
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
