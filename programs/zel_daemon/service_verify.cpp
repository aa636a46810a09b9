// The service's verification by itself: slices of the tasks' shares, one at a time, where nothing
// else wants to be done.
#include <algorithm>
#include <utility>

#include "ZEL/log.h"
#include "programs/common/mounts_below.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service.h"

namespace zel_daemon {

namespace {

using programs::Printable;
using ZEL::Logger;

constexpr uint64_t kMiB = uint64_t{1} << 20;
// Each end reads so much in silence, unless one file has more.
constexpr uint64_t kSliceBytes = 1024 * kMiB;
// A slice that was ended so often for runs of its task goes on beside the next one.
constexpr unsigned int kMostWays = 3;
constexpr size_t kLogged = 20;
constexpr int64_t kDayMs = int64_t{24} * 3600 * 1000;
// More than this is compared as a whole.
constexpr size_t kMaxAlone = 10000;

void LogDamage(const std::string& task, const std::string& share, const VerifiedSlice& slice,
               const std::map<std::string, uint64_t>& known) {
    size_t count = 0;
    for (const auto& [path, length] : slice.damaged) {
        if (known.count(path) == 0 && ++count <= kLogged) {
            Logger::LogMsg(Logger::LEVEL_ERROR,
                           "[ERROR] zel_daemon(%d): task '%s': DAMAGED %s in share '%s': other "
                           "bytes at the two ends under the same size and time\n",
                           __LINE__, Printable(task).c_str(), Printable(path).c_str(),
                           Printable(share).c_str());
        }
    }
    if (count > kLogged) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): task '%s': and %zu more\n",
                       __LINE__, Printable(task).c_str(), count - kLogged);
    }
}

}  // namespace

void Service::SetVerification(Task& task, bool other_copies) {
    const TaskRecord& record = task.machine.Record();
    if (verify_ && verify_->Order().task_id == record.ID()) {
        verify_->Cancel();
    }
    task.verification.Set(record.Info().GetShareList(),
                          static_cast<unsigned int>(record.Number("verify_days")), other_copies);
    task.verify_at = 0;
    task.verify_problem.clear();
}

// Begins the next slice where one is due; else says when to look again. What is due but not at rest
// is looked at again when that has changed.
void Service::VerifySome(bool others_wait, std::optional<int64_t>& wait) {
    if (verify_ || others_wait) {
        return;
    }
    std::optional<int64_t> soonest;
    std::string share;
    Task* const task = NextToVerify(share, soonest);
    if (task != nullptr) {
        StartSlice(*task, share);
    } else if (soonest && (!wait || *soonest < *wait)) {
        wait = soonest;
    }
}

// All tasks in turn, so that none with much to read holds up the others.
Service::Task* Service::NextToVerify(std::string& share, std::optional<int64_t>& wait) {
    const int64_t elapsed = clock_.Elapsed();
    const int64_t now = clock_.Now();
    Task* next = nullptr;
    const auto look = [&](Task& task) {
        const std::optional<int64_t> due = task.verification.Next(now);
        if (next != nullptr || !due) {
            return;
        }
        const int64_t at = std::max(std::max(verify_at_, task.verify_at),
                                    elapsed + std::clamp<int64_t>((*due - now) * 1000, 0, kDayMs));
        if (at > elapsed) {
            wait = std::min(wait.value_or(at - elapsed), at - elapsed);
            return;
        }
        const auto found = task.verification.Due(
            now, [&](const std::string& name) { return task.machine.IsAtRest(name); });
        if (found) {
            next = &task;
            share = *found;
        }
    };
    const auto middle = tasks_.upper_bound(verified_task_);
    std::for_each(middle, tasks_.end(), [&](auto& entry) { look(entry.second); });
    std::for_each(tasks_.begin(), middle, [&](auto& entry) { look(entry.second); });
    return next;
}

void Service::StartSlice(Task& task, const std::string& share) {
    const TaskRecord& record = task.machine.Record();
    VerifyOrder order;
    order.task_id = record.ID();
    order.task = record.Name();
    order.share = share;
    order.info = record.Info().GetSyncInfo();
    order.excludes = record.ExcludeRules();
    order.round = task.verification.RoundAt(share, clock_.Now());
    order.damaged = task.verification.DamagedIn(share);
    order.limits = {config_.verify_files, kSliceBytes};
    verified_task_ = order.task_id;
    verify_at_ = clock_.Elapsed() + config_.verify_gap.count();
    verify_ = std::make_unique<VerifyRun>(
        loop_, std::move(order), [this](const VerifyOutcome& outcome) { EndSlice(outcome); });
}

void Service::EndSlice(const VerifyOutcome& outcome) {
    const VerifyOrder order = verify_->Order();
    const bool cancelled = verify_->Cancelled();
    verify_.reset();
    const auto found = tasks_.find(order.task_id);
    if (found == tasks_.end() || cancelled) {
        Advance();
        return;
    }
    Task& task = found->second;
    if (outcome.problem.empty()) {
        // What was read quickly is not made up for at once: the rate is that of hours.
        verify_at_ = std::max<int64_t>(
            verify_at_, clock_.Elapsed() + static_cast<int64_t>(outcome.bytes * 1000 /
                                                                (config_.verify_rate * kMiB)));
        task.gave_way = 0;
        LogDamage(order.task, order.share, outcome.slice, order.damaged);
        StoreSlice(task, order.share, outcome.slice);
        size_t sent = 0;
        for (const std::string& path : outcome.differing) {
            if (++sent <= kMaxAlone) {
                SendDifference(task, order.share, path, sent == kMaxAlone);
            }
        }
    } else {
        task.verify_at = clock_.Elapsed() + config_.retry_max.count();
        if (task.verify_problem != outcome.problem) {
            Logger::LogMsg(Logger::LEVEL_INFO,
                           "[INFO] zel_daemon(%d): task '%s': share '%s' is not verified: %s\n",
                           __LINE__, Printable(order.task).c_str(), Printable(order.share).c_str(),
                           Printable(programs::OneLine(outcome.problem)).c_str());
        }
    }
    task.verify_problem = outcome.problem;
    Advance();
}

void Service::StoreSlice(Task& task, const std::string& share, VerifiedSlice slice) {
    if (slice.ends_round) {
        slice.round.ended = clock_.Now();
    }
    const auto& known = task.verification.DamagedIn(share);
    size_t room = Verification::kMaxDamaged - std::min(Verification::kMaxDamaged, known.size());
    for (auto file = slice.damaged.begin(); file != slice.damaged.end();) {
        const bool is_new = known.count(file->first) == 0;
        if (is_new && room == 0) {
            file = slice.damaged.erase(file);
            continue;
        }
        room -= is_new ? 1 : 0;
        ++file;
    }
    try {
        store_.EndSlice(task.machine.Record().ID(), share, slice);
        task.verification.Done(share, slice);
    } catch (const programs::Failure& failure) {
        // The next slice begins where this one did.
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): %s\n", __LINE__,
                       failure.what());
        task.verify_at = clock_.Elapsed() + config_.retry_max.count();
    }
}

// A run of the task begins: what is read for a verification waits, but not for ever.
void Service::GiveWay(Task& task) {
    if (verify_ && !verify_->Cancelled() &&
        verify_->Order().task_id == task.machine.Record().ID() && task.gave_way < kMostWays) {
        ++task.gave_way;
        verify_->Cancel();
    }
}

// A push that has replaced or removed a damaged file at the server has settled that.
void Service::ForgetReplaced(Task& task, const programs::RunResult& result) {
    for (const auto& [share, changes] : result.copies) {
        VerifiedSlice slice;
        slice.well = task.verification.Replaced(share, changes);
        if (!slice.well.empty()) {
            slice.round = task.verification.All().at(share).round;
            StoreSlice(task, share, std::move(slice));
        }
    }
}

// A person has had files compared: what is known of their damage is what was found now.
void Service::NoteVerified(const programs::RunOrder& order,
                           const std::map<std::string, std::map<std::string, uint64_t>>& damaged) {
    const auto found = tasks_.find(order.task_id);
    if (found == tasks_.end()) {
        return;
    }
    Verification& verification = found->second.verification;
    for (const programs::ShareOrder& part : order.shares) {
        if (!verification.Has(part.share)) {
            continue;
        }
        VerifiedSlice slice;
        if (const auto now = damaged.find(part.share); now != damaged.end()) {
            slice.damaged = now->second;
        }
        for (const auto& [path, length] : verification.DamagedIn(part.share)) {
            const bool was_read = std::any_of(part.paths.begin(), part.paths.end(),
                                              [name = "/" + path](const auto& above) {
                                                  return programs::IsAtOrBelow(name, above);
                                              });
            if (was_read && slice.damaged.count(path) == 0) {
                slice.well.push_back(path);
            }
        }
        if (!slice.damaged.empty() || !slice.well.empty()) {
            slice.round = verification.All().at(part.share).round;
            StoreSlice(found->second, part.share, std::move(slice));
        }
    }
}

// What a person's verification finds: see SendDifference(); damage is kept until it ends.
programs::ChangeHandler Service::SendDifferences(PreviewJob& job) {
    return [this, &job, count = std::map<std::string, size_t>()](
               const std::string& share, const TARQ::Backup::RunChange& change) mutable {
        if (change.damaged) {
            std::map<std::string, uint64_t>& damaged = job.damaged[share];
            if (damaged.size() < Verification::kMaxDamaged) {
                damaged.emplace(change.path, change.length);
            }
            return;
        }
        if (++count[share] > kMaxAlone) {
            return;
        }
        const bool all = count[share] == kMaxAlone;
        loop_.Post([this, task_id = job.order.task_id, share, path = change.path, all] {
            if (const auto task = tasks_.find(task_id); task != tasks_.end()) {
                SendDifference(task->second, share, path, all);
            }
        });
    };
}

// What a realtime task has at the server otherwise than here, though no event told so, is a change,
// and sent. Of what is damaged nobody knows which side is right: that is left to a person. `all`:
// there are so many that the share is compared whole.
void Service::SendDifference(Task& task, const std::string& share, const std::string& path,
                             bool all) {
    const auto watched = shares_.find(share);
    if (watched == shares_.end()) {
        return;
    }
    const std::vector<Task*>& tasks = watched->second.tasks;
    if (std::find(tasks.begin(), tasks.end(), &task) != tasks.end()) {
        all ? task.machine.Differs(share) : task.machine.Changed(share, "/" + path);
    }
}

}  // namespace zel_daemon
