#include "programs/zel_daemon/task_machine.h"

#include <algorithm>
#include <utility>

#include "programs/common/text.h"
#include "tarq/rsync_wrapper.h"

namespace zel_daemon {

namespace {

using programs::FailureKind;
using programs::Reach;
using programs::RunFailure;

// A store that could not be written is tried again after so long.
constexpr int64_t kStoreRetryMs = 10000;
// What is far off is looked at again now and then.
constexpr int64_t kLongestWaitMs = int64_t{24} * 3600 * 1000;
// What failed and changes again is tried so often at most.
constexpr int64_t kChangedAgainMs = 60000;

// A receiver that died in a copy has left what it had of a file beside it, under another name.
bool BrokeOff(const RunFailure& failure) {
    return failure.reach == Reach::kShare &&
           (failure.Status() == TARQ::Backup::STATUS_SOCKET ||
            failure.Status() == TARQ::Backup::STATUS_PROTOCOL_STREAM ||
            failure.Status() == TARQ::Backup::STATUS_TIMEOUT);
}

}  // namespace

TaskMachine::TaskMachine(TaskRecord record, const Clock& clock, const DaemonConfig& config,
                         std::function<double()> random)
    : clock_(clock), config_(config), random_(std::move(random)) {
    Edited(std::move(record));
}

void TaskMachine::MakePlan() {
    plan_.emplace(clock_, record_.Info().GetSchedule(), record_.checked_until, random_);
    held_ = false;
    unwatched_.clear();
}

// ---- The question ----

Step TaskMachine::NextStep() {
    using Kind = Step::Kind;
    const int64_t now = clock_.Elapsed();
    const int64_t writable = std::max(now, store_retry_at_);
    Step step;
    const auto add = [&](Kind kind, int64_t moment) {
        const int64_t wait = std::max(moment, writable) - now;
        if (!step.wait || wait < *step.wait) {
            step.wait = wait;
            step.kind = wait == 0 ? kind : Kind::kWait;
        }
    };
    if (ended_) {
        add(Kind::kStoreEnd, now);
    }
    if (record_changed_) {
        add(Kind::kStoreRecord, now);
    }
    if (HasDebounced()) {
        add(Kind::kStoreChanges, std::min(last_change_ + config_.debounce.count(),
                                          *first_change_ + config_.debounce_max.count()));
    }
    if (!unwatched_.empty() && !running_ && !held_ && !plan_->RetryAt()) {
        add(Kind::kRescan, poll_at_);
    }
    if (step.kind != Kind::kWait) {
        return step;
    }
    const std::optional<int64_t> run = NextRunAt(step);
    if (run && std::max(*run, writable) <= now) {
        due_since_ = due_since_ != 0 ? due_since_ : now;
        step.kind = Kind::kRun;
        return step;
    }
    due_since_ = 0;
    if (run) {
        add(Kind::kWait, *run);
    }
    return step;
}

// When a run is due, as things are; now or earlier: at once, and `step` says which.
std::optional<int64_t> TaskMachine::NextRunAt(Step& step) {
    const int64_t now = clock_.Elapsed();
    // Before a run's end is stored, what it was sending would be left out.
    if (running_ || ended_) {
        return std::nullopt;
    }
    if (requested_ || (!record_.paused && plan_->ScheduleDue())) {
        step.reason = requested_ ? RunReason::kRequest : RunReason::kSchedule;
        step.all = true;
        return now;
    }
    if (record_.paused) {
        return std::nullopt;
    }
    const std::optional<int64_t> retry = plan_->RetryAt();
    std::optional<int64_t> run = held_ ? std::nullopt : debts_.Next();
    if (run && retry) {
        run = std::max(*run, *retry);
    }
    step.reason = retry ? RunReason::kRetry : RunReason::kChange;
    if (const auto next = plan_->NextRun()) {
        const int64_t scheduled =
            now + std::clamp<int64_t>((*next - clock_.Now()) * 1000, 1, kLongestWaitMs);
        run = std::min(run.value_or(scheduled), scheduled);
    }
    return run;
}

// ---- What happens ----

void TaskMachine::Restored(bool has_changes, std::optional<RunRecord> last) {
    if (has_changes && record_.IsRealtime()) {
        for (const std::string& share : record_.Info().GetShareList()) {
            debts_.OweChanges(share);
        }
    }
    last_ = std::move(last);
    if (last_ && last_->result == ZEL::TASK_RESULT_FAILED) {
        plan_->Failed(Delays());
        debts_.OweResyncs();
    }
}

void TaskMachine::Edited(TaskRecord record) {
    record_ = std::move(record);
    MakePlan();
    debounced_.clear();
    first_change_.reset();
    debts_.SetShares(record_.Info().GetShareList());
    if (record_.IsRealtime()) {
        debts_.OweResyncs();
    }
}

void TaskMachine::PauseSet(TaskRecord record) {
    record_ = std::move(record);
    MakePlan();
    if (record_.IsRealtime()) {
        debts_.Release();
        debts_.OweResyncs();
    } else {
        debts_.Forgive();
    }
}

void TaskMachine::Changed(const std::string& share, const std::string& path) {
    debounced_[share].Add(path);
    last_change_ = clock_.Elapsed();
    first_change_ = first_change_.value_or(last_change_);
    held_ = false;
}

void TaskMachine::Lost(const std::string& share, bool lasting) {
    debts_.OweResync(share);
    held_ = false;
    if (lasting) {
        unwatched_.insert(share);
        poll_at_ = NextPoll();
    }
}

void TaskMachine::Watched(const std::string& share) {
    debts_.OweResync(share);
    unwatched_.erase(share);
}

// A server that many ask because the network comes and goes is spared: between two tries lies the
// first wait.
void TaskMachine::Recovered(const std::set<Recovery>& what,
                            const std::function<bool(const std::string& share)>& is_there) {
    const bool volume = what.count(Recovery::kVolume) != 0;
    const bool network = what.count(Recovery::kNetwork) != 0;
    const bool settings = what.count(Recovery::kSettings) != 0;
    const int64_t gap = config_.retry_first.count();
    if ((network || settings) && !running_) {
        plan_->Hasten(gap);
    }
    debts_.Hasten(clock_.Elapsed(), gap, [&](const std::string& share, FailureKind kind) {
        return kind == FailureKind::kLocal ? (volume || settings) && is_there(share)
                                           : settings || (network && kind == FailureKind::kFailed);
    });
}

void TaskMachine::Asked() {
    if (!running_) {
        requested_ = true;
        held_ = false;
    }
}

bool TaskMachine::Cancelled() {
    if (!running_ && due_since_ == 0 && !UntilRetry()) {
        return false;
    }
    requested_ = false;
    by_person_ = running_.has_value();
    held_ = record_.IsRealtime();
    plan_->Settled();
    if (held_) {
        debts_.Release();
    } else {
        debts_.Forgive();
    }
    TakeSchedule();
    return true;
}

// The run that the schedule wants now, if it does, is made or given up.
void TaskMachine::TakeSchedule() {
    if (plan_->ScheduleDue()) {
        plan_->ScheduleTaken();
        record_.checked_until = plan_->CheckedUntil();
        record_changed_ = true;
    }
}

// ---- Steps ----

void TaskMachine::StoreFailed(const std::string& problem) {
    store_problem_ = problem;
    store_retry_at_ = clock_.Elapsed() + kStoreRetryMs;
    if (!running_) {
        PutBack();
    }
}

void TaskMachine::EndStored() {
    ended_.reset();
    store_problem_.clear();
}

void TaskMachine::RecordStored() {
    record_changed_ = false;
    store_problem_.clear();
}

std::map<std::string, std::vector<std::string>> TaskMachine::DebouncedChanges() {
    std::map<std::string, std::vector<std::string>> folded;
    for (auto& [share, changes] : debounced_) {
        folded[share] = changes.Take();
        for (const std::string& path : folded[share]) {  // they are held until they are stored
            changes.Add(path);
        }
    }
    return folded;
}

void TaskMachine::ChangesStored() {
    for (const auto& [share, changes] : debounced_) {
        debts_.OweChanges(share);
    }
    debounced_.clear();
    first_change_.reset();
    store_problem_.clear();
}

void TaskMachine::Rescanned() {
    poll_at_ = NextPoll();
    for (const std::string& share : unwatched_) {
        debts_.OweResync(share);
    }
}

std::optional<RunPlan> TaskMachine::Begin(const Step& step, const ReadChanges& read) {
    const int64_t now = clock_.Elapsed();
    if (step.all) {
        debts_.Release();
        debts_.OweResyncs();
    }
    RunPlan plan;
    plan.order.task = record_.Name();
    plan.order.task_id = record_.ID();
    plan.order.excludes = record_.ExcludeRules();
    plan.order.announce = false;
    plan.record.task_id = record_.ID();
    plan.record.reason = step.reason;
    plan.record.start = clock_.Now();
    for (const ShareDebts::Due& due : debts_.Take(now)) {
        ChangeSet changes;
        if (due.stored) {
            for (ZEL::Event& event : read(due.share, due.after)) {
                changes.Add(event.GetRelativePath());
                plan.events.push_back(std::move(event));
            }
        }
        if (due.resync) {
            plan.order.shares.push_back({due.share, {"/"}, false});
            plan.order.announce = true;
        } else if (!changes.Empty()) {
            plan.order.shares.push_back({due.share, changes.Take(), due.rest_waits});
        } else if (due.rest_waits) {
            // What changed is what has failed before: that may have mended it.
            debts_.Hasten(now, kChangedAgainMs, [&](const std::string& share, FailureKind) {
                return share == due.share;
            });
        }
        if (due.again && step.reason == RunReason::kChange) {
            plan.record.reason = RunReason::kRetry;
        }
    }
    if (plan.order.shares.empty()) {
        debts_.Settle(now, {}, Delays(), 0);
        plan_->Settled();
        return std::nullopt;
    }
    return plan;
}

// A run that could not begin: all that was taken for it is owed as it was.
void TaskMachine::PutBack() {
    std::map<std::string, ShareDebts::Outcome> outcomes;
    for (const std::string& share : record_.Info().GetShareList()) {
        outcomes[share].tried = false;
    }
    debts_.Settle(clock_.Elapsed(), outcomes, Delays(), 0);
}

void TaskMachine::Started(RunPlan plan) {
    TakeSchedule();
    requested_ = false;
    by_person_ = false;
    due_since_ = 0;
    store_problem_.clear();
    if (plan.order.announce) {
        poll_at_ = NextPoll();
    }
    running_ = std::move(plan);
}

const RunRecord& TaskMachine::Ended(const programs::RunResult& result,
                                    const programs::RunTotals& totals) {
    const RunPlan plan = std::move(*std::exchange(running_, std::nullopt));
    const auto& failure = result.failure;
    RunRecord& record = last_.emplace(plan.record);
    record.end = clock_.Now();
    if (failure) {
        record.status = failure->Status();
        record.error = failure->what();
        record.details = failure->details;
    }
    record.files_sent = totals.files_sent;
    record.files_deleted = totals.files_deleted;
    record.bytes_sent = totals.bytes_sent;
    record.rsync_runs = totals.rsync_runs;
    record.result = !failure     ? ZEL::TASK_RESULT_SUCCESS
                    : by_person_ ? ZEL::TASK_RESULT_CANCELLED
                                 : ZEL::TASK_RESULT_FAILED;
    if (record.result == ZEL::TASK_RESULT_FAILED && failure->reach == Reach::kRun) {
        plan_->Failed(Delays());
    } else {
        plan_->Settled();
    }
    Settle(plan, result);
    return record;
}

// What the run has sent is forgotten, what it has not is owed.
void TaskMachine::Settle(const RunPlan& plan, const programs::RunResult& result) {
    std::map<std::string, std::vector<const std::string*>> unsent_paths;
    std::map<std::string, ShareDebts::Outcome> outcomes;
    for (const programs::Undone& undone : result.undone) {
        ShareDebts::Outcome& outcome = outcomes[undone.share];
        if (!outcome.failed || undone.failure.reach == Reach::kShare) {
            outcome.reach = undone.failure.reach;
            outcome.kind = undone.failure.Kind();
        }
        outcome.failed = true;
        outcome.tried = outcome.tried && undone.failure.reach != Reach::kRun;
        outcome.broke_off = outcome.broke_off || BrokeOff(undone.failure);
        for (const std::string& path : undone.paths) {
            unsent_paths[undone.share].push_back(&path);
        }
    }
    RunEnd& end = ended_.emplace();
    for (const ZEL::Event& event : plan.events) {
        const auto unsent = unsent_paths.find(event.GetShareName());
        const bool sent =
            unsent == unsent_paths.end() ||
            std::none_of(unsent->second.begin(), unsent->second.end(), [&](const auto* path) {
                return ChangeSet::Covers(*path, event.GetRelativePath());
            });
        (sent ? end.sent : end.unsent).push_back(event.GetID());
        if (!sent) {
            uint64_t& last = outcomes[event.GetShareName()].last_change;
            last = std::max(last, event.GetID());
        }
    }
    debts_.Settle(clock_.Elapsed(), outcomes, Delays(), plan_->Chance());
    if (by_person_ && !record_.IsRealtime()) {
        debts_.Forgive();
    }
}

// ---- What is so ----

bool TaskMachine::AnyShare(const Step& step,
                           const std::function<bool(const std::string& share)>& test) const {
    const std::list<std::string>& shares = record_.Info().GetShareList();
    return step.all ? std::any_of(shares.begin(), shares.end(), test)
                    : debts_.AnyDue(clock_.Elapsed(), test);
}

std::optional<int64_t> TaskMachine::NextRun() const {
    return record_.paused ? std::nullopt : plan_->NextRun();
}

std::optional<int64_t> TaskMachine::UntilRetry() const {
    const std::optional<int64_t> retry = plan_->RetryAt() ? plan_->RetryAt() : debts_.NextRetry();
    return retry ? std::optional(std::max<int64_t>(*retry - clock_.Elapsed(), 0)) : std::nullopt;
}

std::string TaskMachine::WaitsFor() const {
    if (plan_->RetryAt()) {
        return "waits for its server; tried at once when the network changes";
    }
    const ShareDebts::Waiting waiting = debts_.WhatWaits();
    if (waiting.shares == 0) {
        return "";
    }
    std::string words = "share '" + programs::Printable(waiting.first) + "'";
    if (waiting.shares > 1) {
        words += " and " + programs::Count(waiting.shares - 1, "other share") + " wait";
    } else {
        words += " waits";
    }
    switch (waiting.kind) {
        case FailureKind::kLocal:
            return words + " for the volume or folder; tried at once when it is there";
        case FailureKind::kRefused:
            return words + " for the server to take it";
        case FailureKind::kBusy:
            return words + " until fewer files change while they are read";
        default:
            return words + " for the next try";
    }
}

}  // namespace zel_daemon
