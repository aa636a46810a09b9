#include "programs/zel_daemon/task_machine.h"

#include <algorithm>
#include <unordered_set>
#include <utility>

#include "programs/common/share_path.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"

namespace zel_daemon {

namespace {

using programs::FailureKind;
using programs::Reach;

// Of what a failed run leaves in the history.
constexpr size_t kMaxErrorBytes = size_t{8} * 1024;
constexpr size_t kMaxDetailBytes = size_t{32} * 1024;
// A store that could not be written is tried again after so long.
constexpr int64_t kStoreRetryMs = 10000;
// What is far off is looked at again now and then.
constexpr int64_t kDayMs = int64_t{24} * 3600 * 1000;
constexpr int64_t kLongestWaitMs = kDayMs;
// What failed and changes again is tried so often at most.
constexpr int64_t kChangedAgainMs = 60000;
// Whether the path or a folder above it is among `paths`.
bool IsCovered(std::string path, const std::unordered_set<std::string>& paths) {
    while (path.size() > 1 && paths.count(path) == 0) {
        path = programs::FolderAbove(path);
    }
    return paths.count(path) != 0;
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
    to_search_.clear();
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
    if (compare_at_ && *compare_at_ <= now && !running_ && !ended_) {
        OweComparisons();
    }
    if (compare_at_ && *compare_at_ > now) {
        add(Kind::kWait, std::min(*compare_at_, now + kLongestWaitMs));
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

// The shares of a realtime task are compared whole now and then: the watch may have missed
// something, and the copy may have been changed at the server.
void TaskMachine::PlanComparison() {
    const auto days = static_cast<int64_t>(record_.Number("compare_days"));
    compare_at_.reset();
    if (days == 0 || !record_.IsRealtime()) {
        return;
    }
    for (const auto& [share, comparison] : compared_) {
        const int64_t due = comparison.elapsed + days * kDayMs;
        compare_at_ = std::min(compare_at_.value_or(due), due);
    }
}

void TaskMachine::OweComparisons() {
    const int64_t due =
        clock_.Elapsed() - static_cast<int64_t>(record_.Number("compare_days")) * kDayMs;
    for (auto at = compared_.begin(); at != compared_.end();) {
        if (at->second.elapsed <= due) {
            debts_.OweResync(at->first);
            at = compared_.erase(at);
        } else {
            ++at;
        }
    }
    PlanComparison();
}

// ---- What happens ----

void TaskMachine::Restored(bool has_changes, std::optional<RunRecord> last, Questions questions,
                           const CopyLedger::Files& files) {
    copies_.Restore(files);
    questions_ = std::move(questions);
    last_ = std::move(last);
    const bool failed = last_ && last_->result == ZEL::TASK_RESULT_FAILED;
    if (failed) {
        plan_->Failed(Delays());
    }
    if (record_.IsRealtime()) {
        debts_.Forgive();
        for (const std::string& share : record_.Info().GetShareList()) {
            if (has_changes) {
                debts_.OweChanges(share);
                copies_.ChangedBefore(share);
            }
            OweSearch(share);
        }
    } else if (failed) {
        debts_.OweResyncs();
    }
}

// Something may have changed without a word. What is compared whole anyhow need not be searched.
void TaskMachine::OweSearch(const std::string& share) {
    moves_.MayHaveChanged(share);
    if (record_.IsRealtime() && debts_.Has(share) &&
        debts_.StateOf(share) == ShareState::kTracked) {
        to_search_[share] = ++last_search_;
    }
}

void TaskMachine::Searched(const std::string& share, uint64_t number,
                           std::optional<int64_t> compared) {
    const auto found = to_search_.find(share);
    if (found == to_search_.end() || found->second != number) {
        return;
    }
    to_search_.erase(found);
    if (!compared) {
        debts_.OweResync(share);
    } else if (compared_.count(share) == 0) {
        const int64_t age = std::max<int64_t>(clock_.Now() - *compared, 0) * 1000;
        compared_[share] = {clock_.Elapsed() - age, *compared};
        PlanComparison();
    }
    // Nothing is left of what the last run failed at.
    if (to_search_.empty() && !debts_.Next() && !HasDebounced()) {
        plan_->Settled();
    }
}

void TaskMachine::Edited(TaskRecord record) {
    copies_.SetShares(record.Info().GetShareList(),
                      !programs::SameAccount(record_.ToMap(), record.ToMap()));
    record_ = std::move(record);
    MakePlan();
    debounced_.clear();
    moves_.DropWaiting();
    first_change_.reset();
    compared_.clear();
    PlanComparison();
    questions_.clear();
    consents_.clear();
    debts_.SetShares(record_.Info().GetShareList());
    if (record_.IsRealtime()) {
        debts_.OweResyncs();
    }
}

void TaskMachine::PauseSet(TaskRecord record) {
    record_ = std::move(record);
    consents_.clear();
    MakePlan();
    if (record_.IsRealtime()) {
        debts_.Release();
        for (const std::string& share : record_.Info().GetShareList()) {
            OweSearch(share);
        }
    } else {
        debts_.Forgive();
    }
}

// Whether the copy has what is at the path, and nothing says otherwise.
bool TaskMachine::IsInStep(const std::string& share, const std::string& path) {
    return debts_.Has(share) && !debts_.Owes(share) && to_search_.count(share) == 0 &&
           unwatched_.count(share) == 0 && !debounced_[share].Touches(path);
}

void TaskMachine::Changed(const std::string& share, const std::string& path) {
    moves_.Changed(share, path);
    NoteChange(share, path);
}

void TaskMachine::NoteChange(const std::string& share, const std::string& path) {
    debounced_[share].Add(path);
    copies_.Changed(share, path);
    last_change_ = clock_.Elapsed();
    first_change_ = first_change_.value_or(last_change_);
    held_ = false;
}

void TaskMachine::Moved(const std::string& share, const std::string& from, const std::string& to) {
    const std::string name = from.substr(0, from.find_last_not_of('/') + 1);
    moves_.Moved(share, name, to, debounced_[share].Holds(name), IsInStep(share, name));
    NoteChange(share, from);
    NoteChange(share, to);
}

void TaskMachine::HeardAll() {
    if (!running_) {
        moves_.HeardAll();
    }
}

void TaskMachine::Lost(const std::string& share, bool lasting) {
    OweSearch(share);
    held_ = false;
    if (lasting) {
        unwatched_.insert(share);
        poll_at_ = NextPoll();
    }
}

void TaskMachine::Watched(const std::string& share) {
    OweSearch(share);
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
        switch (kind) {
            case FailureKind::kLocal:
                return (volume || settings) && is_there(share);
            case FailureKind::kConfirm:  // what was missing may be there again
                return volume || settings;
            default:
                return settings || (network && kind == FailureKind::kFailed);
        }
    });
}

void TaskMachine::Asked() {
    if (!running_) {
        requested_ = true;
        held_ = false;
    }
}

bool TaskMachine::Confirmed() {
    for (const auto& [share, question] : questions_) {
        consents_[share] = {question.reason, question.amount};
        requested_ = true;
        held_ = false;
    }
    return !questions_.empty();
}

bool TaskMachine::Cancelled() {
    if (!running_ && due_since_ == 0 && !UntilRetry()) {
        return false;
    }
    requested_ = false;
    consents_.clear();
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

const std::vector<programs::ShareMove>& TaskMachine::DebouncedMoves(const std::string& share) {
    return moves_.Waiting(share);
}

void TaskMachine::ChangesStored() {
    for (const auto& [share, changes] : debounced_) {
        debts_.OweChanges(share);
    }
    moves_.Stored();
    debounced_.clear();
    first_change_.reset();
    store_problem_.clear();
}

void TaskMachine::Rescanned() {
    poll_at_ = NextPoll();
    for (const std::string& share : unwatched_) {
        OweSearch(share);
    }
}

std::optional<RunPlan> TaskMachine::Begin(const Step& step, const ReadChanges& read,
                                          const ReadMoves& read_moves) {
    const int64_t now = clock_.Elapsed();
    if (step.all) {
        debts_.Release();
        debts_.OweResyncs();
    }
    RunPlan plan;
    plan.order.task = record_.Name();
    plan.order.task_id = record_.ID();
    plan.order.excludes = record_.ExcludeRules();
    plan.order.bandwidth = record_.Limits();
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
            to_search_.erase(due.share);
            plan.order.shares.push_back({due.share, {"/"}, false});
            plan.order.announce = true;
        } else if (!changes.Empty()) {
            const bool rest_waits = due.rest_waits || to_search_.count(due.share) != 0;
            plan.order.shares.push_back({due.share, changes.Take(), rest_waits});
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
    const auto brake = static_cast<unsigned int>(record_.Number("brake"));
    for (programs::ShareOrder& order : plan.order.shares) {
        plan.moves[order.share] = read_moves(order.share);
        for (const StoredMove& stored : plan.moves[order.share]) {
            order.moves.push_back(stored.move);
            moves_.Mark(order.share, order.moves.back());
        }
        order.brake = copies_.Take(order, brake);
        if (const auto consent = consents_.find(order.share); consent != consents_.end()) {
            order.consent = consent->second;
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
    copies_.PutBack();
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
    moves_.RunBegins();
}

const RunRecord& TaskMachine::Ended(const programs::RunResult& result,
                                    const programs::RunTotals& totals) {
    const RunPlan plan = std::move(*std::exchange(running_, std::nullopt));
    const auto& failure = result.failure;
    RunRecord& record = last_.emplace(plan.record);
    record.end = clock_.Now();
    if (failure) {
        record.status = failure->Status();
        // A server may complain at any length; what it says goes into the store and into replies.
        record.error = programs::Shortened(failure->what(), kMaxErrorBytes);
        record.details = programs::Shortened(failure->details, kMaxDetailBytes);
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

// The shares that were sent whole, and nothing of which failed, have been compared.
void TaskMachine::NoteCompared(const RunPlan& plan, const programs::RunResult& result) {
    std::set<std::string> failed;
    for (const programs::Undone& undone : result.undone) {
        failed.insert(undone.share);
    }
    for (const programs::ShareOrder& order : plan.order.shares) {
        if (order.paths == std::vector<std::string>{"/"} && failed.count(order.share) == 0) {
            compared_[order.share] = {clock_.Elapsed(), clock_.Now()};
        }
    }
    PlanComparison();
    int64_t oldest = clock_.Now();
    for (const std::string& share : record_.Info().GetShareList()) {
        const auto found = compared_.find(share);
        if (found == compared_.end()) {
            return;
        }
        oldest = std::min(oldest, found->second.moment);
    }
    // What is known from an index is when that comparison began, not when it had ended.
    const bool is_later = record_.compared <= clock_.Now() && oldest < record_.compared;
    record_changed_ = record_changed_ || (oldest != record_.compared && !is_later);
    record_.compared = is_later ? record_.compared : oldest;
}

// A share that was pushed has nothing left to ask; one that failed for another reason is asked
// about again at its next try. A consent that was given while the run was under way holds for the
// next.
void TaskMachine::SettleQuestions(const RunPlan& plan, const programs::RunResult& result) {
    std::map<std::string, std::optional<programs::Question>>& settled = ended_->questions;
    std::set<std::string> failed;
    for (const programs::Undone& undone : result.undone) {
        failed.insert(undone.share);
        if (undone.failure.question) {
            settled[undone.share] = undone.failure.question;
        }
    }
    for (const programs::ShareOrder& order : plan.order.shares) {
        if (failed.count(order.share) == 0 && questions_.count(order.share) != 0) {
            settled[order.share] = std::nullopt;
        }
        if (order.consent && (failed.count(order.share) == 0 || settled.count(order.share) != 0)) {
            consents_.erase(order.share);
        }
    }
    for (const auto& [share, question] : settled) {
        if (question) {
            questions_[share] = *question;
        } else {
            questions_.erase(share);
        }
    }
}

// What the run has sent is forgotten, what it has not is owed.
void TaskMachine::Settle(const RunPlan& plan, const programs::RunResult& result) {
    std::map<std::string, std::unordered_set<std::string>> unsent_paths;  // by share
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
        unsent_paths[undone.share].insert(undone.paths.begin(), undone.paths.end());
    }
    NoteCompared(plan, result);
    RunEnd& end = ended_.emplace();
    SettleQuestions(plan, result);
    end.files = copies_.Settle(plan.order, result, clock_.Elapsed() / 1000);
    for (const ZEL::Event& event : plan.events) {
        const auto unsent = unsent_paths.find(event.GetShareName());
        const bool sent =
            unsent == unsent_paths.end() || !IsCovered(event.GetRelativePath(), unsent->second);
        (sent ? end.sent : end.unsent).push_back(event.GetID());
        if (!sent) {
            uint64_t& last = outcomes[event.GetShareName()].last_change;
            last = std::max(last, event.GetID());
        }
    }
    for (const auto& [share, moves] : plan.moves) {
        if (outcomes.count(share) == 0 || result.moved.count(share) != 0) {
            for (const StoredMove& stored : moves) {
                moves_.Forget(share, stored.move);
                end.moved.push_back(stored.id);
            }
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

bool TaskMachine::IsAtRest() const {
    return !record_.paused && !running_ && !ended_ && !requested_ && due_since_ == 0 &&
           !HasDebounced() && to_search_.empty() && !plan_->RetryAt() && questions_.empty() &&
           store_problem_.empty() && last_.has_value();
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
        case FailureKind::kConfirm:
            return "";  // the question says it
        case FailureKind::kBusy:
            return words + " until fewer files change while they are read";
        default:
            return words + " for the next try";
    }
}

}  // namespace zel_daemon
