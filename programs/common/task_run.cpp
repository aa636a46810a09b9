#include "programs/common/task_run.h"

#include <chrono>
#include <utility>

#include "ZEL/rsyncer.h"
#include "ZEL/zel.h"
#include "programs/common/beacon.h"
#include "programs/common/host.h"
#include "programs/common/present_paths.h"
#include "programs/common/server_status.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using std::chrono::steady_clock;
using TARQ::Backup::RunCause;
using TARQ::Backup::RunChange;
using TARQ::Backup::RunOptions;
using TARQ::Backup::RunProgress;
using TARQ::Backup::RunReport;

constexpr std::chrono::seconds kLastWord(1);
constexpr int kVanishedFiles = 24;  // rsync: some files were gone before it came to them

// A share that changes while it is copied is copied so often in one run.
constexpr int kBusyTries = 3;
// The names of the shares in one pairing command: a command carries 5 KiB.
constexpr size_t kMaxPairedBytes = size_t{3} * 1024;

std::list<std::string> ToList(const std::vector<std::string>& items) {
    return {items.begin(), items.end()};
}

std::string Explain(int status, const RunReport& report) {
    std::string server_text = ServerStatusText(status);
    if (!server_text.empty() && (status >= kFirstServerStatus || report.explanation.empty())) {
        return server_text;
    }
    return !report.explanation.empty()
               ? report.explanation
               : "status " + std::to_string(status) + " (see the system log)";
}

bool IsAtTheTop(const std::string& path) {
    return path.size() > 1 && path.rfind('/') == 0;
}

std::string Quoted(const std::string& share) {
    return "share '" + Printable(share) + "'";
}

// What the failure of a command for one share says of the others.
Reach ReachOfCommand(int status) {
    switch (status) {
        case kDone:  // something here, of the share's
        case kBadArgument:
        case kOtherAccount:
        case kConflicts:
        case kNoEncryption:
        case kStorage:
        case kNameTaken:
        case kNotRunning:
            return Reach::kShare;
        default:
            return Reach::kRun;
    }
}

void CheckShare(const std::string& share) {
    const std::string problem = ShareProblem(share);
    if (!problem.empty()) {
        throw RunFailure(FailureKind::kLocal, 0, problem, Reach::kShare);
    }
}

// Whether `step` succeeds; one that fails leaves all of the share's order undone.
template <typename Step>
bool Succeeds(const ShareOrder& share, std::vector<Undone>& undone, Step step) {
    try {
        step();
        return true;
    } catch (const RunFailure& failure) {
        undone.push_back({share.share, share.paths, failure});
        return false;
    }
}

}  // namespace

struct TaskRun::Impl {
    Impl(const ZEL::SyncInfo& sync_info, const std::atomic<bool>& cancel_flag, RunListener told)
        : info(sync_info), cancel(cancel_flag), listener(std::move(told)) {
        rsyncer.SetTaskSetup([this](ZEL::Rsyncer::RsyncTask& task) {
            task.SetCanceller([this] { return cancel && steady_clock::now() >= patient_until; });
            task.setRunOptions(options);
        });
    }

    // The driver for one operation: what that runs has these options, and leaves its report.
    ZEL::Rsyncer& With(RunOptions wanted = {}) {
        options = std::move(wanted);
        report = RunReport();
        options.report = &report;
        return rsyncer;
    }

    // This is said even when a person has had enough, unless the server takes too long to listen.
    int LastWord(const std::string& type, const std::string& name, int& status) {
        patient_until = steady_clock::now() + kLastWord;
        const int sent = With().FinishSync(type, name, status);
        patient_until = {};
        return sent;
    }

    RunFailure Failed(const std::string& what, int status, Reach reach = Reach::kRun) const {
        if (cancel) {
            return {FailureKind::kCancelled, 0,
                    "ended by the user; the next run completes the copy"};
        }
        const std::string why = status == 0 ? "see the system log" : Explain(status, report);
        return {status == 0 ? FailureKind::kLocal : KindOf(status), status, what + ": " + why,
                reach, report.details};
    }

    bool Silent() const { return report.status == TARQ::Backup::STATUS_TIMEOUT; }

    // Finds the server. One that answers the probe, and then not the question for its version, is
    // not a server without versions: what comes next would be put to it in the wrong form.
    void Find() {
        int status = With().Initialize(info);
        const bool version_failed = report.status > kDone && report.status != kUnknownCommand &&
                                    report.status != kUnsupportedCommand;
        if (status == 0 && (version_failed || cancel)) {
            status = report.status;
        }
        connected = status == 0;
        if (!connected) {
            const std::string& name = info.GetServerName();
            throw Failed("cannot use server " + (name.empty() ? info.GetServerIP() : name), status);
        }
    }

    // One command pairs as many shares as it carries.
    void Pair(bool dry_run, const std::vector<std::string>& shares) {
        for (size_t begin = 0; begin < shares.size();) {
            size_t end = begin;
            for (size_t bytes = 0; end < shares.size(); ++end) {
                bytes += shares[end].size() + 1;
                if (end > begin && bytes > kMaxPairedBytes) {
                    break;
                }
            }
            PairTogether(dry_run, {&shares[begin], &shares[begin] + (end - begin)});
            begin = end;
        }
    }

    void PairTogether(bool dry_run, const std::list<std::string>& shares) {
        std::list<std::string> conflicts;
        int status = 0;
        const int asked = With().DoPairing(dry_run, shares, conflicts, status);
        // A server that pairs no shares by name may say that it has merely taken the command.
        if (asked == 0 && (status == kDone || status == kAccepted || status == kPassedThrough)) {
            return;
        }
        const Reach reach = ReachOfCommand(status);
        if (cancel || asked != 0 || status != kConflicts || conflicts.empty()) {
            throw Failed(
                "the server does not take " +
                    (shares.size() == 1 ? Quoted(shares.front()) : std::string("these shares")),
                status, reach);
        }
        std::string taken;
        for (const std::string& share : conflicts) {
            taken += (taken.empty() ? "" : ", ") + Quoted(share);
        }
        throw RunFailure(FailureKind::kRefused, status,
                         taken + (conflicts.size() == 1 ? " belongs" : " belong") +
                             " to another client or account at the server",
                         reach);
    }

    // Announces a share, and pairs first when the server does not know this client. For this share
    // alone: one that the server refuses must not stand in the way of the others.
    void Start(const std::string& share) {
        int status = 0;
        for (const bool may_pair : {true, false}) {
            if (With().StartSyncShare(share, status) != 0) {
                throw Failed(Quoted(share) + " cannot be announced", 0, Reach::kShare);
            }
            if (status != kNotPaired || !may_pair) {
                break;
            }
            Pair(false, {share});
            if (listener.on_paired) {
                listener.on_paired(rsyncer.GetLatestIP());
            }
        }
        if (status != kDone) {
            throw Failed("the server does not take " + Quoted(share), status,
                         ReachOfCommand(status));
        }
    }

    void SendKey(const std::string& share) {
        const int status = With().SyncEncryptKey(share);
        if (status != 0) {
            throw Failed("the key of encrypted " + Quoted(share) + " cannot be sent", status,
                         Reach::kShare);
        }
    }

    // The server's answer is no reason to end the run; that there is none is: each of the commands
    // and copies that follow would wait as long for its own.
    void Announce(const std::string& task) {
        int status = 0;
        With().SendBeacon(task, status);
        if (Silent()) {
            throw Failed("the server does not answer", report.status);
        }
    }

    // Throws only before any of them is begun.
    void PushShares(const RunOrder& order, const ShareOrders& shares, RunTotals& totals,
                    std::vector<Undone>& undone) {
        if (!connected) {
            Find();
        }
        if (order.announce) {
            Announce(order.task);
        }
        Beacon beacon(rsyncer.GetSyncInfo(), order.task);
        for (auto share = shares.begin(); share != shares.end();) {
            const size_t before = undone.size();
            PushShare(order, **share, totals, undone);
            ++share;
            if (undone.size() == before) {
                continue;
            }
            RunFailure end = undone.back().failure;
            if (end.reach == Reach::kRun || !heard) {
                end.reach = Reach::kRun;
                LeaveUndone({share, shares.end()}, end, false, undone);
                break;
            }
        }
        const bool announced = beacon.Stop() || order.announce;
        totals.rsync_runs += rsync_runs;
        if (announced && heard) {
            int ignored = 0;
            LastWord("task", order.task, ignored);
        }
    }

    // Adds to `undone` what the server has not taken.
    void PushShare(const RunOrder& order, const ShareOrder& share, RunTotals& totals,
                   std::vector<Undone>& undone) {
        if (!Succeeds(share, undone, [&] { Start(share.share); })) {
            heard = !Silent();
            return;
        }
        const auto begin = steady_clock::now();
        const size_t undone_before = undone.size();
        RunReport sent;
        Succeeds(share, undone, [&] {
            SendKey(share.share);
            // Once more, right before files are compared: an unmounted volume must not look like
            // an emptied share.
            CheckShare(share.share);
            SendPaths(order, share, sent, undone);
        });
        totals.files_sent += sent.files_sent;
        totals.files_deleted += sent.files_deleted;
        totals.bytes_sent += sent.bytes_sent + sent.bytes_received;
        const std::chrono::duration<double> elapsed = steady_clock::now() - begin;
        const bool completed = undone.size() == undone_before;
        heard = completed || !Silent();
        if (heard &&
            Succeeds(share, undone, [&] { Finish(share.share, completed, share.rest_waits); }) &&
            completed && listener.on_share_done) {
            listener.on_share_done(share.share, sent, elapsed.count());
        }
    }

    void SendPaths(const RunOrder& order, const ShareOrder& share, RunReport& sent,
                   std::vector<Undone>& undone) {
        ZEL::ShareInfo facts;
        if (rsyncer.GetShareInfo(share.share, facts) != 0) {
            throw Failed(Quoted(share.share) + " cannot be looked up", 0, Reach::kShare);
        }
        std::vector<PresentPath> paths = PresentPaths(facts.GetModulePath(), share.paths);
        bool touched_folder = false;
        for (auto path = paths.begin(); path != paths.end(); ++path) {
            touched_folder = touched_folder || IsAtTheTop(path->path);
            try {
                SendFiles(order, share.share, path->path, sent);
            } catch (const RunFailure& failure) {
                undone.push_back({share.share, std::move(path->ordered), failure});
                if (failure.reach == Reach::kPaths) {
                    continue;
                }
                std::vector<std::string>& left = undone.back().paths;
                while (++path != paths.end()) {
                    left.insert(left.end(), path->ordered.begin(), path->ordered.end());
                }
                return;
            }
        }
        if (touched_folder) {
            SendFolderItself(order, share.share, sent);
        }
    }

    // A path is sent with the folders above it, but not with the share's own, whose time the
    // server's changes with what is sent straight into it. That is no part of any path: what is
    // excluded is neither sent nor deleted.
    void SendFolderItself(const RunOrder& order, const std::string& share, RunReport& sent) {
        int status = 0;
        With().RunSync(order.task_id, share, "/", {"/*"}, status);
        sent.bytes_sent += report.bytes_sent;
        sent.bytes_received += report.bytes_received;
    }

    void SendFiles(const RunOrder& order, const std::string& share, const std::string& path,
                   RunReport& sent) {
        RunOptions wishes;
        wishes.bandwidth_limit = info.GetMaxBandwidth();
        if (listener.on_progress) {
            wishes.on_progress = [&](const RunProgress& progress) {
                listener.on_progress(share, progress);
            };
        }
        int status = 0;
        int ran = 0;
        for (int i = 0; i < kBusyTries; ++i) {
            ran = With(wishes).RunSync(order.task_id, share, path, ToList(order.excludes), status);
            if (ran == 0 && status == 0 && report.status < 0) {
                // Nothing was there to run for. A path that has gone meanwhile is a change that
                // will be told, of the folder above it; a share that has gone is a fault.
                if (path == "/") {
                    throw RunFailure(FailureKind::kLocal, 0, Quoted(share) + ": its folder is gone",
                                     Reach::kShare);
                }
                return;
            }
            ++rsync_runs;
            sent.files_sent += report.files_sent;
            sent.files_deleted += report.files_deleted;
            sent.files_total += report.files_total;
            sent.bytes_total += report.bytes_total;
            sent.bytes_sent += report.bytes_sent;
            sent.bytes_received += report.bytes_received;
            if (report.cause != RunCause::BUSY_SOURCE || cancel) {
                break;
            }
        }
        // Files that vanished under rsync's hands are changes that will be told, too.
        if (ran == 0 && (status == 0 || status == kVanishedFiles)) {
            return;
        }
        const bool busy = report.cause == RunCause::BUSY_SOURCE;
        const bool part = busy || report.cause == RunCause::UNREADABLE_SOURCE;
        const std::string what =
            path == "/" ? " is not complete" : ": " + Printable(path) + " is not complete";
        const RunFailure failed =
            Failed(Quoted(share) + what, status, part ? Reach::kPaths : Reach::kShare);
        if (busy && failed.Kind() == FailureKind::kFailed) {
            throw RunFailure(FailureKind::kBusy, status, failed.what(), failed.reach,
                             failed.details);
        }
        throw failed;
    }

    void Finish(const std::string& share, bool completed, bool rest_waits) {
        int status = 0;
        const int sent = LastWord(completed && !rest_waits ? "share" : "abort", share, status);
        const bool confirmed = sent == 0 && status == kDone;
        heard = (!cancel || confirmed) && !Silent();
        if (completed && !confirmed) {
            throw Failed("the server does not confirm " + Quoted(share), status,
                         ReachOfCommand(status));
        }
    }

    void ListShare(const RunOrder& order, const ShareOrder& share, const ChangeHandler& on_change,
                   const std::function<void(const std::string&)>& on_missing) {
        for (const std::string& path : share.paths) {
            RunOptions wishes;
            wishes.dry_run = true;
            wishes.on_change = [&](const RunChange& change) { on_change(share.share, change); };
            int status = 0;
            const int ran = With(wishes).RunSync(order.task_id, share.share, path,
                                                 ToList(order.excludes), status);
            if (ran == 0 && status != 0 && report.cause == TARQ::Backup::RunCause::UNKNOWN_MODULE) {
                on_missing(share.share);
                return;
            }
            if (ran != 0 || (status != 0 && status != kVanishedFiles)) {
                throw Failed(Quoted(share.share) + " cannot be compared", status);
            }
        }
    }

    ZEL::SyncInfo info;
    const std::atomic<bool>& cancel;
    RunListener listener;
    RunOptions options;                      // of the operation under way
    RunReport report;                        // of the last thing that was run
    steady_clock::time_point patient_until;  // whatever is wanted
    bool connected = false;                  // an address of the server has answered
    uint64_t rsync_runs = 0;                 // copies made
    bool heard = true;  // false: an answer to a last word would be waited for in vain
    ZEL::Rsyncer rsyncer;
};

TaskRun::TaskRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel, RunListener listener)
    : impl_(std::make_unique<Impl>(info, cancel, std::move(listener))) {}

TaskRun::~TaskRun() = default;

void TaskRun::Connect() {
    impl_->Find();
}

void TaskRun::CheckPairing(const std::vector<std::string>& shares) {
    impl_->Pair(true, shares);
}

RunResult TaskRun::Push(const RunOrder& order, RunTotals& totals) {
    impl_->rsync_runs = 0;
    impl_->heard = true;
    RunResult result;
    ShareOrders ready;
    for (const ShareOrder& share : order.shares) {
        if (Succeeds(share, result.undone, [&] { CheckShare(share.share); })) {
            ready.push_back(&share);
        }
    }
    // A share that is away is no reason to speak to the server.
    if (!ready.empty()) {
        try {
            impl_->PushShares(order, ready, totals, result.undone);
        } catch (const RunFailure& failure) {
            LeaveUndone(ready, failure, true, result.undone);
        }
    }
    result.failure = Sum(result.undone);
    return result;
}

void TaskRun::List(const RunOrder& order, const ChangeHandler& on_change,
                   const std::function<void(const std::string& share)>& on_missing) {
    for (const ShareOrder& share : order.shares) {
        impl_->ListShare(order, share, on_change, on_missing);
    }
}

}  // namespace programs
