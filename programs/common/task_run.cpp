#include "programs/common/task_run.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <iterator>
#include <mutex>
#include <system_error>
#include <thread>
#include <utility>

#include "ZEL/log.h"
#include "ZEL/rsyncer.h"
#include "ZEL/zel.h"
#include "base/open_beneath.h"
#include "base/unique_fd.h"
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

constexpr std::chrono::seconds kBeaconEvery(60);  // the server takes a task for dead after 120
constexpr std::chrono::seconds kLastWord(1);
constexpr int kVanishedFiles = 24;  // rsync: some files were gone before it came to them

// A share that changes while it is copied is copied so often in one run.
constexpr int kBusyTries = 3;
// The names of the shares in one pairing command: a command carries 5 KiB.
constexpr size_t kMaxPairedBytes = size_t{3} * 1024;
// The failures of a run are told up to here: messages and rows of the history have a limit.
constexpr size_t kMaxToldBytes = size_t{6} * 1024;
constexpr size_t kMaxDetailBytes = size_t{16} * 1024;

std::list<std::string> ToList(const std::vector<std::string>& items) {
    return {items.begin(), items.end()};
}

/// Tells the server that the run is alive, from a thread and a connection of its own.
class Beacon {
public:
    Beacon(const ZEL::SyncInfo& info, std::string task) : info_(info), task_(std::move(task)) {
        try {
            thread_ = std::thread([this] { Run(); });
        } catch (const std::system_error& error) {
            // As one that fails: no reason to end the run.
            ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_WARNING,
                                "[WARNING] task_run(%d): no thread to tell the server that the "
                                "run is alive: %s\n",
                                __LINE__, error.what());
        }
    }
    ~Beacon() { Stop(); }
    Beacon(const Beacon&) = delete;
    Beacon& operator=(const Beacon&) = delete;

    /// Ends the thread. Whether the server was told anything.
    bool Stop() {
        if (thread_.joinable()) {
            {
                const std::lock_guard<std::mutex> lock(mutex_);
                stop_ = true;
            }
            wake_.notify_one();
            thread_.join();
        }
        return sent_;
    }

private:
    void Run() {
        ZEL::Rsyncer rsyncer;
        rsyncer.SetTaskSetup([this](ZEL::Rsyncer::RsyncTask& task) {
            task.SetCanceller([this] { return stop_.load(); });
        });
        bool ready = false;
        std::unique_lock<std::mutex> lock(mutex_);
        while (!wake_.wait_for(lock, kBeaconEvery, [this] { return stop_.load(); })) {
            lock.unlock();
            // A beacon that fails is no reason to end the run.
            ready = ready || rsyncer.Initialize(info_) == 0;
            int status = 0;
            if (ready) {
                sent_ = true;
                rsyncer.SendBeacon(task_, status);
            }
            lock.lock();
        }
    }

    ZEL::SyncInfo info_;
    std::string task_;
    std::mutex mutex_;
    std::condition_variable wake_;
    std::atomic<bool> stop_{false};
    bool sent_ = false;  // the thread's until it was joined
    std::thread thread_;
};

std::string Explain(int status, const RunReport& report) {
    std::string server_text = ServerStatusText(status);
    if (!server_text.empty() && (status >= kFirstServerStatus || report.explanation.empty())) {
        return server_text;
    }
    return !report.explanation.empty()
               ? report.explanation
               : "status " + std::to_string(status) + " (see the system log)";
}

bool IsBelow(const std::string& path, const std::string& folder) {
    return folder == "/" || (path.size() > folder.size() && path[folder.size()] == '/' &&
                             path.compare(0, folder.size(), folder) == 0);
}

// Whether `path` can be sent by itself: a file or folder below the share's folder (open as
// `folder`) that no link on the way leads to, so that nothing outside the share is ever sent. A
// link is sent with the folder that it is in.
bool IsPresent(int folder, const std::string& path) {
    const base::UniqueFd entry =
        base::OpenBeneath(folder, path.substr(path.find_first_not_of('/')), O_PATH);
    struct stat info = {};
    return entry && fstat(entry.Get(), &info) == 0 && !S_ISLNK(info.st_mode);
}

/// A path as it is sent, and those of the order that are taken with it.
struct Part {
    std::string path;
    std::vector<std::string> ordered;
};

// The paths as they are now: one that has gone stands for the nearest folder above that is there,
// where the deletion is seen. No path is below another one.
std::vector<Part> PresentParts(const std::string& folder, const std::vector<std::string>& paths) {
    const base::UniqueFd root(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::vector<Part> present;
    for (const std::string& ordered : paths) {
        std::string path = ordered;
        while (path.find_first_not_of('/') != std::string::npos && !IsPresent(root.Get(), path)) {
            path.resize(std::max<size_t>(path.rfind('/'), 1));
        }
        present.push_back({path, {ordered}});
    }
    std::sort(present.begin(), present.end(),
              [](const Part& one, const Part& other) { return one.path < other.path; });
    std::vector<Part> fewest;
    for (Part& part : present) {
        const auto above = std::find_if(fewest.begin(), fewest.end(), [&](const Part& kept) {
            return part.path == kept.path || IsBelow(part.path, kept.path);
        });
        if (above == fewest.end()) {
            fewest.push_back(std::move(part));
        } else {
            above->ordered.push_back(std::move(part.ordered.front()));
        }
    }
    return fewest;
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

using Orders = std::vector<const ShareOrder*>;

// What a run that has ended did not come to.
void LeaveUndone(Orders::const_iterator begin, Orders::const_iterator end,
                 const RunFailure& failure, std::vector<Undone>& undone) {
    for (; begin != end; ++begin) {
        undone.push_back({(*begin)->share, (*begin)->paths, failure, false});
    }
}

void LeaveAllUndone(const Orders& shares, const RunFailure& failure, std::vector<Undone>& undone) {
    const size_t first = undone.size();
    LeaveUndone(shares.begin(), shares.end(), failure, undone);
    if (first < undone.size()) {
        undone[first].tried = true;  // the failure is told as its own
    }
}

// What a run has failed with: what ended it, or the first, with the others named.
RunFailure Summed(const std::vector<Undone>& undone) {
    std::vector<const Undone*> failed;
    size_t not_tried = 0;
    for (const Undone& item : undone) {
        if (item.tried) {
            failed.push_back(&item);
        } else {
            ++not_tried;
        }
    }
    if (failed.empty()) {
        return {};
    }
    const auto ended = std::find_if(failed.begin(), failed.end(), [](const Undone* item) {
        return item->failure.reach == Reach::kRun;
    });
    if (ended != failed.end()) {
        std::rotate(failed.begin(), ended, std::next(ended));
    }
    RunFailure sum = failed.front()->failure;
    size_t told = 1;
    for (; told < failed.size() && sum.error.size() < kMaxToldBytes; ++told) {
        sum.error += "; " + failed[told]->failure.error;
    }
    for (size_t i = 1; i < failed.size() && !failed[i]->failure.details.empty(); ++i) {
        if (sum.details.size() + failed[i]->failure.details.size() >= kMaxDetailBytes) {
            break;
        }
        sum.details += (sum.details.empty() ? "" : "\n") + failed[i]->failure.details;
    }
    if (told < failed.size()) {
        sum.error += "; and " + std::to_string(failed.size() - told) + " more like these";
    }
    if (not_tried > 0 && sum.kind != FailureKind::kCancelled && failed.size() > 1) {
        sum.error += "; " + Count(not_tried, "share") + " not tried";
    }
    return sum;
}

}  // namespace

FailureKind KindOf(int status) {
    if (status == kNothingSent || status == kKeyFileFailed) {
        return FailureKind::kLocal;
    }
    return status < kFirstServerStatus && status != TARQ::Backup::STATUS_AUTHENTICATION
               ? FailureKind::kFailed
               : FailureKind::kRefused;
}

RunResult NothingDone(const RunOrder& order, const RunFailure& failure) {
    Orders shares;
    for (const ShareOrder& share : order.shares) {
        shares.push_back(&share);
    }
    RunResult result;
    LeaveAllUndone(shares, failure, result.undone);
    result.failure = failure;
    return result;
}

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

    static RunFailure CheckShare(const std::string& share) {
        std::string problem = ShareProblem(share);
        return problem.empty()
                   ? RunFailure()
                   : RunFailure{FailureKind::kLocal, 0, std::move(problem), Reach::kShare};
    }

    // Finds the server. One that answers the probe, and then not the question for its version, is
    // not a server without versions: what comes next would be put to it in the wrong form.
    RunFailure Find() {
        int status = With().Initialize(info);
        const bool version_failed = report.status > kDone && report.status != kUnknownCommand &&
                                    report.status != kUnsupportedCommand;
        if (status == 0 && (version_failed || cancel)) {
            status = report.status;
        }
        connected = status == 0;
        const std::string& name = info.GetServerName();
        return connected ? RunFailure()
                         : Failed("cannot use server " + (name.empty() ? info.GetServerIP() : name),
                                  status);
    }

    // One command pairs as many shares as it carries.
    RunFailure Pair(bool dry_run, const std::vector<std::string>& shares) {
        for (size_t begin = 0; begin < shares.size();) {
            size_t end = begin;
            for (size_t bytes = 0; end < shares.size(); ++end) {
                bytes += shares[end].size() + 1;
                if (end > begin && bytes > kMaxPairedBytes) {
                    break;
                }
            }
            RunFailure paired =
                PairTogether(dry_run, {&shares[begin], &shares[begin] + (end - begin)});
            if (!paired.Ok()) {
                return paired;
            }
            begin = end;
        }
        return {};
    }

    RunFailure PairTogether(bool dry_run, const std::list<std::string>& shares) {
        std::list<std::string> conflicts;
        int status = 0;
        const int asked = With().DoPairing(dry_run, shares, conflicts, status);
        // A server that pairs no shares by name may say that it has merely taken the command.
        if (asked == 0 && (status == kDone || status == kAccepted || status == kPassedThrough)) {
            return {};
        }
        const Reach reach = ReachOfCommand(status);
        if (cancel || asked != 0 || status != kConflicts || conflicts.empty()) {
            return Failed(shares.size() == 1 ? "the server does not take " + Quoted(shares.front())
                                             : std::string("the server does not take these shares"),
                          status, reach);
        }
        std::string taken;
        for (const std::string& share : conflicts) {
            taken += (taken.empty() ? "" : ", ") + Quoted(share);
        }
        return {FailureKind::kRefused, status,
                taken + (conflicts.size() == 1 ? " belongs" : " belong") +
                    " to another client or account at the server",
                reach};
    }

    // Announces a share, and pairs first when the server does not know this client. For this share
    // alone: one that the server refuses must not stand in the way of the others.
    RunFailure Start(const std::string& share) {
        for (const bool may_pair : {true, false}) {
            int status = 0;
            if (With().StartSyncShare(share, status) != 0) {
                return Failed(Quoted(share) + " cannot be announced", 0, Reach::kShare);
            }
            if (status == kNotPaired && may_pair) {
                RunFailure paired = Pair(false, {share});
                if (!paired.Ok()) {
                    return paired;
                }
                if (listener.on_paired) {
                    listener.on_paired(rsyncer.GetLatestIP());
                }
                continue;
            }
            return status == kDone ? RunFailure()
                                   : Failed("the server does not take " + Quoted(share), status,
                                            ReachOfCommand(status));
        }
        return {};
    }

    RunFailure SendKey(const std::string& share) {
        const int status = With().SyncEncryptKey(share);
        return status == 0 ? RunFailure()
                           : Failed("the key of encrypted " + Quoted(share) + " cannot be sent",
                                    status, Reach::kShare);
    }

    // The server's answer is no reason to end the run; that there is none is: each of the commands
    // and copies that follow would wait as long for its own.
    RunFailure Announce(const std::string& task) {
        int status = 0;
        With().SendBeacon(task, status);
        return Silent() ? Failed("the server does not answer", report.status) : RunFailure();
    }

    void PushShares(const RunOrder& order, const Orders& shares, RunTotals& totals,
                    std::vector<Undone>& undone) {
        if (shares.empty()) {
            return;
        }
        int ignored = 0;
        bool announced = order.announce;
        {
            if (announced) {
                const RunFailure told = Announce(order.task);
                if (!told.Ok()) {
                    LeaveAllUndone(shares, told, undone);
                    return;
                }
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
                    LeaveUndone(share, shares.end(), end, undone);
                    break;
                }
            }
            announced = beacon.Stop() || announced;
        }
        totals.rsync_runs += rsync_runs;
        if (announced && heard) {
            LastWord("task", order.task, ignored);
        }
    }

    // Adds to `undone` what the server has not taken.
    void PushShare(const RunOrder& order, const ShareOrder& share, RunTotals& totals,
                   std::vector<Undone>& undone) {
        RunFailure result = Start(share.share);
        if (!result.Ok()) {
            heard = !Silent();
            undone.push_back({share.share, share.paths, std::move(result)});
            return;
        }
        const auto begin = steady_clock::now();
        const size_t undone_before = undone.size();
        RunReport sent;
        result = SendKey(share.share);
        if (result.Ok()) {
            // Once more, right before files are compared: an unmounted volume must not look like
            // an emptied share.
            result = CheckShare(share.share);
        }
        if (result.Ok()) {
            SendPaths(order, share, sent, undone);
        } else {
            undone.push_back({share.share, share.paths, std::move(result)});
        }
        totals.files_sent += sent.files_sent;
        totals.files_deleted += sent.files_deleted;
        totals.bytes_sent += sent.bytes_sent + sent.bytes_received;
        const std::chrono::duration<double> elapsed = steady_clock::now() - begin;
        const bool completed = undone.size() == undone_before;
        heard = completed || !Silent();
        if (!heard) {
            return;
        }
        RunFailure closed = Finish(share.share, completed, share.rest_waits);
        if (completed && !closed.Ok()) {
            undone.push_back({share.share, share.paths, std::move(closed)});
        } else if (completed && listener.on_share_done) {
            listener.on_share_done(share.share, sent, elapsed.count());
        }
    }

    void SendPaths(const RunOrder& order, const ShareOrder& share, RunReport& sent,
                   std::vector<Undone>& undone) {
        ZEL::ShareInfo facts;
        if (rsyncer.GetShareInfo(share.share, facts) != 0) {
            undone.push_back(
                {share.share, share.paths,
                 Failed(Quoted(share.share) + " cannot be looked up", 0, Reach::kShare)});
            return;
        }
        const bool whole = share.paths == std::vector<std::string>{"/"};
        std::vector<Part> parts = whole ? std::vector<Part>{{"/", {"/"}}}
                                        : PresentParts(facts.GetModulePath(), share.paths);
        bool touched_folder = false;
        for (size_t i = 0; i < parts.size(); ++i) {
            RunFailure result = SendFiles(order, share.share, parts[i].path, sent);
            touched_folder = touched_folder || IsAtTheTop(parts[i].path);
            if (result.Ok()) {
                continue;
            }
            const bool goes_on = result.reach == Reach::kPaths;
            undone.push_back({share.share, std::move(parts[i].ordered), std::move(result)});
            if (!goes_on) {
                Undone& failed = undone.back();
                while (++i < parts.size()) {
                    failed.paths.insert(failed.paths.end(), parts[i].ordered.begin(),
                                        parts[i].ordered.end());
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

    RunFailure SendFiles(const RunOrder& order, const std::string& share, const std::string& path,
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
                return path == "/"
                           ? RunFailure{FailureKind::kLocal, 0,
                                        Quoted(share) + ": its folder is gone", Reach::kShare}
                           : RunFailure();
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
            return {};
        }
        const bool busy = report.cause == RunCause::BUSY_SOURCE;
        const bool part = busy || report.cause == RunCause::UNREADABLE_SOURCE;
        const std::string what =
            path == "/" ? " is not complete" : ": " + Printable(path) + " is not complete";
        RunFailure failed =
            Failed(Quoted(share) + what, status, part ? Reach::kPaths : Reach::kShare);
        if (busy && failed.kind == FailureKind::kFailed) {
            failed.kind = FailureKind::kBusy;
        }
        return failed;
    }

    RunFailure Finish(const std::string& share, bool completed, bool rest_waits) {
        int status = 0;
        const int sent = LastWord(completed && !rest_waits ? "share" : "abort", share, status);
        heard = (!cancel || (sent == 0 && status == kDone)) && !Silent();
        if (completed && (sent != 0 || status != kDone)) {
            return Failed("the server does not confirm " + Quoted(share), status,
                          ReachOfCommand(status));
        }
        return {};
    }

    RunFailure ListShare(const RunOrder& order, const ShareOrder& share,
                         const ChangeHandler& on_change,
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
                return {};
            }
            if (ran != 0 || (status != 0 && status != kVanishedFiles)) {
                return Failed(Quoted(share.share) + " cannot be compared", status);
            }
        }
        return {};
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

RunFailure TaskRun::Connect() {
    return impl_->Find();
}

RunFailure TaskRun::CheckPairing(const std::vector<std::string>& shares) {
    return impl_->Pair(true, shares);
}

RunResult TaskRun::Push(const RunOrder& order, RunTotals& totals) {
    impl_->rsync_runs = 0;
    impl_->heard = true;
    RunResult result;
    Orders ready;
    for (const ShareOrder& share : order.shares) {
        RunFailure fit = Impl::CheckShare(share.share);
        if (fit.Ok()) {
            ready.push_back(&share);
        } else {
            result.undone.push_back({share.share, share.paths, std::move(fit)});
        }
    }
    // A share that is away is no reason to speak to the server.
    const RunFailure found = ready.empty() || impl_->connected ? RunFailure() : impl_->Find();
    if (found.Ok()) {
        impl_->PushShares(order, ready, totals, result.undone);
    } else {
        LeaveAllUndone(ready, found, result.undone);
    }
    result.failure = Summed(result.undone);
    return result;
}

RunFailure TaskRun::List(const RunOrder& order, const ChangeHandler& on_change,
                         const std::function<void(const std::string& share)>& on_missing) {
    for (const ShareOrder& share : order.shares) {
        RunFailure result = impl_->ListShare(order, share, on_change, on_missing);
        if (!result.Ok()) {
            return result;
        }
    }
    return {};
}

}  // namespace programs
