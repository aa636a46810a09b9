#include "programs/zel_daemon/verify_run.h"

#include <fcntl.h>
#include <sys/statvfs.h>

#include <algorithm>
#include <cerrno>
#include <set>
#include <utility>

#include "ZEL/zel.h"
#include "base/unique_fd.h"
#include "programs/common/task_run.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using programs::RunOrder;
using TARQ::Backup::RunChange;

// No share has more than its volume, unless something else is mounted below it.
void Estimate(const std::string& folder, VerifyRound& round) {
    struct statvfs volume = {};
    if (statvfs(folder.c_str(), &volume) == 0) {
        round.all_bytes = uint64_t{volume.f_blocks - volume.f_bfree} * volume.f_frsize;
        round.all_files = volume.f_files - volume.f_ffree;
    }
}

// A file that this process may not read says nothing of its content.
bool IsForbidden(const std::string& path) {
    const base::UniqueFd file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    return !file && (errno == EACCES || errno == EPERM);
}

}  // namespace

VerifyRun::VerifyRun(EventLoop& loop, VerifyOrder order, const OnEnd& on_end)
    : order_(std::move(order)), worker_(loop) {
    worker_.Start<VerifyOutcome>([this] { return Work(); },
                                 [](const std::string& why) {
                                     VerifyOutcome outcome;
                                     outcome.problem = why;
                                     return outcome;
                                 },
                                 on_end);
}

VerifyOutcome VerifyRun::Work() const {
    VerifyOutcome outcome;
    outcome.problem = RunProblem();
    if (outcome.problem.empty()) {
        outcome.problem = ShareProblem(order_.share);
    }
    ZEL::ShareInfo facts;
    if (outcome.problem.empty() && ZEL::GetShareInfo(order_.share, facts) != 0) {
        outcome.problem = "share '" + order_.share + "' cannot be looked up";
    }
    if (!outcome.problem.empty()) {
        return outcome;
    }
    const std::string folder = facts.GetModulePath();
    const Slice slice =
        TakeSlice(folder, order_.round.place, order_.limits, [this] { return cancel_.load(); });
    if (!cancel_ && !slice.files.empty()) {
        Compare(slice.files, outcome);
    }
    if (cancel_) {
        outcome.problem = "it was ended";
        return outcome;
    }
    // One that changed while it was read looks like damage, but not twice.
    const std::string top = folder + "/";
    std::vector<std::string> suspects;
    for (const auto& [path, length] : std::exchange(outcome.slice.damaged, {})) {
        if (!IsForbidden(top + path)) {
            suspects.push_back(path);
        }
    }
    if (!suspects.empty()) {
        Compare(suspects, outcome);
    }
    for (const auto& [path, length] : order_.damaged) {
        const bool was_read = ComesBefore(order_.round.place, path) &&
                              (slice.is_last || !ComesBefore(slice.end, path));
        if (was_read && outcome.slice.damaged.count(path) == 0) {
            outcome.slice.well.push_back(path);
        }
    }
    outcome.bytes = slice.bytes;
    VerifyRound& round = outcome.slice.round = order_.round;
    if (round.ended == 0) {
        Estimate(folder, round);
    }
    round.place = slice.end;
    round.files += slice.files.size();
    round.bytes += slice.bytes;
    if (slice.is_last) {
        outcome.slice.ends_round = true;
        round.goes_on = false;
        round.place.clear();
        round.all_files = round.files;
        round.all_bytes = round.bytes;
    }
    return outcome;
}

void VerifyRun::Compare(const std::vector<std::string>& files, VerifyOutcome& outcome) const {
    RunOrder order;
    order.task = order_.task;
    order.task_id = order_.task_id;
    order.excludes = order_.excludes;
    order.by_content = true;
    order.background = true;
    order.shares.push_back({order_.share});
    order.shares.back().files = files;
    programs::TaskRun run(order_.info, cancel_);
    run.Connect();
    run.CheckPairing({order_.share});
    run.List(
        order,
        [&](const std::string&, const RunChange& change) {
            if (change.kind == RunChange::SEND && change.damaged) {
                outcome.slice.damaged[change.path] = change.length;
            } else if (change.kind == RunChange::SEND) {
                outcome.differing.push_back(change.path);
            }
        },
        [](const std::string& share) {
            throw programs::RunFailure(programs::FailureKind::kRefused, 0,
                                       "the server holds no copy of share '" + share + "'");
        });
}

}  // namespace zel_daemon
