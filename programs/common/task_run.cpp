#include "programs/common/task_run.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
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
using TARQ::Backup::RunChange;
using TARQ::Backup::RunOptions;
using TARQ::Backup::RunProgress;
using TARQ::Backup::RunReport;
using TARQ::Backup::ScopedRunOptions;

constexpr std::chrono::seconds kBeaconEvery(60);  // the server takes a task for dead after 120
constexpr std::chrono::seconds kLastWord(1);
constexpr int kVanishedFiles = 24;  // rsync: some files were gone before it came to them
constexpr int kLookupFailed = 42;
constexpr int kNothingSent = 213;
constexpr int kFirstServerStatus = 200;

std::list<std::string> ToList(const std::vector<std::string>& items) {
    return {items.begin(), items.end()};
}

// The library asks a function without an argument whether to give up: what it looks at is the
// thread's own.
thread_local const std::atomic<bool>* wanted = nullptr;
thread_local steady_clock::time_point patient_until;  // whatever is wanted

bool CancelWanted() {
    return wanted != nullptr && wanted->load(std::memory_order_relaxed) &&
           steady_clock::now() >= patient_until;
}

/// The operations of this thread look at `cancel` until the scope ends.
class CancelScope {
public:
    explicit CancelScope(const std::atomic<bool>& cancel)
        : before_(std::exchange(wanted, &cancel)) {}
    ~CancelScope() { wanted = before_; }
    CancelScope(const CancelScope&) = delete;
    CancelScope& operator=(const CancelScope&) = delete;

private:
    const std::atomic<bool>* before_;
};

/// What is said in this scope is said even when a person has had enough, unless the server takes
/// too long to listen.
class LastWord {
public:
    LastWord() { patient_until = steady_clock::now() + kLastWord; }
    ~LastWord() { patient_until = {}; }
    LastWord(const LastWord&) = delete;
    LastWord& operator=(const LastWord&) = delete;
};

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
        const CancelScope scope(stop_);
        ZEL::Rsyncer rsyncer;
        rsyncer.SetCancelChecker(CancelWanted);
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
    if (status == kLookupFailed) {
        return "no such server: its name cannot be looked up";
    }
    if (status == kNothingSent) {
        return "this machine has no identity to show to the server: no serial number and no "
               "network interface; give it one in /usr/tarq/etc/tarqsdk.conf";
    }
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

// The paths as they are now: one that has gone stands for the nearest folder above that is there,
// where the deletion is seen. No path is below another one.
std::vector<std::string> PresentPaths(const std::string& folder,
                                      const std::vector<std::string>& paths) {
    const base::UniqueFd root(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::vector<std::string> present;
    for (std::string path : paths) {
        while (path.find_first_not_of('/') != std::string::npos && !IsPresent(root.Get(), path)) {
            path.resize(std::max<size_t>(path.rfind('/'), 1));
        }
        present.push_back(path);
    }
    std::sort(present.begin(), present.end());
    std::vector<std::string> fewest;
    for (std::string& path : present) {
        const bool covered = std::any_of(
            fewest.begin(), fewest.end(),
            [&](const std::string& above) { return path == above || IsBelow(path, above); });
        if (!covered) {
            fewest.push_back(std::move(path));
        }
    }
    return fewest;
}

std::string Quoted(const std::string& share) {
    return "share '" + Printable(share) + "'";
}

}  // namespace

Trouble TroubleOf(int status) {
    if (status == kNothingSent) {
        return Trouble::kLocal;
    }
    return status < kFirstServerStatus ? Trouble::kFailed : Trouble::kRefused;
}

struct TaskRun::Impl {
    Impl(const ZEL::SyncInfo& sync_info, const std::atomic<bool>& cancel_flag, RunListener told)
        : info(sync_info), cancel(cancel_flag), listener(std::move(told)) {
        rsyncer.SetCancelChecker(CancelWanted);
    }

    RunOptions Reporting() {
        RunOptions wishes;
        report = RunReport();
        wishes.report = &report;
        return wishes;
    }

    Verdict Failed(const std::string& what, int status) const {
        if (cancel) {
            return {Trouble::kCancelled, 0, "ended by the user; the next run completes the copy"};
        }
        const std::string why = status == 0 ? "see the system log" : Explain(status, report);
        return {status == 0 ? Trouble::kLocal : TroubleOf(status), status, what + ": " + why};
    }

    static Verdict CheckShare(const std::string& share) {
        std::string problem = ShareProblem(share);
        return problem.empty() ? Verdict() : Verdict{Trouble::kLocal, 0, std::move(problem)};
    }

    Verdict Pair(bool dry_run, const std::vector<std::string>& shares) {
        std::list<std::string> conflicts;
        int status = 0;
        const ScopedRunOptions watched(Reporting());
        if (rsyncer.DoPairing(dry_run, ToList(shares), conflicts, status) != 0) {
            return Failed("the server does not take these shares", status);
        }
        if (status == kDone) {
            return {};
        }
        std::string taken;
        for (const std::string& share : conflicts) {
            taken += (taken.empty() ? "" : ", ") + Quoted(share);
        }
        return {Trouble::kRefused, status,
                taken + (conflicts.size() == 1 ? " belongs" : " belong") +
                    " to another client or account at the server"};
    }

    // Announces a share, and pairs first when the server does not know this client.
    Verdict Start(const std::string& share, const std::vector<std::string>& all_shares) {
        for (const bool may_pair : {true, false}) {
            int status = 0;
            {
                const ScopedRunOptions watched(Reporting());
                if (rsyncer.StartSyncShare(share, status) != 0) {
                    return Failed(Quoted(share) + " cannot be announced", 0);
                }
            }
            if (status == kNotPaired && may_pair) {
                Verdict paired = Pair(false, all_shares);
                if (!paired.Ok()) {
                    return paired;
                }
                if (listener.on_paired) {
                    listener.on_paired(rsyncer.GetLatestIP());
                }
                continue;
            }
            return status == kDone ? Verdict()
                                   : Failed("the server does not take " + Quoted(share), status);
        }
        return {};
    }

    Verdict SendKey(const std::string& share) {
        const ScopedRunOptions watched(Reporting());
        const int status = rsyncer.SyncEncryptKey(share);
        return status == 0
                   ? Verdict()
                   : Failed("the key of encrypted " + Quoted(share) + " cannot be sent", status);
    }

    Verdict PushShare(const RunOrder& order, const ShareOrder& share,
                      const std::vector<std::string>& all_shares, RunTotals& totals) {
        Verdict result = Start(share.share, all_shares);
        if (result.Ok()) {
            result = SendKey(share.share);
        }
        if (!result.Ok()) {
            return result;
        }
        const auto begin = steady_clock::now();
        RunReport sent;
        // Once more, right before files are compared: an unmounted volume must not look like an
        // emptied share.
        result = CheckShare(share.share);
        if (result.Ok()) {
            result = SendPaths(order, share, sent);
        }
        totals.files_sent += sent.files_sent;
        totals.files_deleted += sent.files_deleted;
        totals.bytes_sent += sent.bytes_sent + sent.bytes_received;
        const std::chrono::duration<double> elapsed = steady_clock::now() - begin;
        Verdict closed = Finish(share.share, result.Ok());
        if (result.Ok() && closed.Ok() && listener.on_share_done) {
            listener.on_share_done(share.share, sent, elapsed.count());
        }
        return result.Ok() ? closed : result;
    }

    Verdict SendPaths(const RunOrder& order, const ShareOrder& share, RunReport& sent) {
        ZEL::ShareInfo facts;
        if (rsyncer.GetShareInfo(share.share, facts) != 0) {
            return Failed(Quoted(share.share) + " cannot be looked up", 0);
        }
        const bool whole = share.paths == std::vector<std::string>{"/"};
        const std::vector<std::string> paths =
            whole ? share.paths : PresentPaths(facts.GetModulePath(), share.paths);
        for (const std::string& path : paths) {
            Verdict result = SendFiles(order, share.share, path);
            sent.files_sent += report.files_sent;
            sent.files_deleted += report.files_deleted;
            sent.files_total += report.files_total;
            sent.bytes_total += report.bytes_total;
            sent.bytes_sent += report.bytes_sent;
            sent.bytes_received += report.bytes_received;
            if (!result.Ok()) {
                return result;
            }
        }
        return {};
    }

    Verdict SendFiles(const RunOrder& order, const std::string& share, const std::string& path) {
        RunOptions wishes = Reporting();
        wishes.bandwidth_limit = info.GetMaxBandwidth();
        if (listener.on_progress) {
            wishes.on_progress = [&](const RunProgress& progress) {
                listener.on_progress(share, progress);
            };
        }
        int status = 0;
        const ScopedRunOptions watched(std::move(wishes));
        const int ran = rsyncer.RunSync(order.task_id, share, path, ToList(order.excludes), status);
        if (ran == 0 && status == 0 && report.status < 0) {
            // Nothing was there to run for. A path that has gone meanwhile is a change that will be
            // told, of the folder above it; a share that has gone is a fault.
            return path == "/" ? Verdict{Trouble::kLocal, 0, Quoted(share) + ": its folder is gone"}
                               : Verdict();
        }
        ++rsync_runs;
        // Files that vanished under rsync's hands are changes that will be told, too.
        return ran == 0 && (status == 0 || status == kVanishedFiles)
                   ? Verdict()
                   : Failed(Quoted(share) + " is not complete", status);
    }

    Verdict Finish(const std::string& share, bool completed) {
        const LastWord last_word;
        const RunReport of_the_run = report;
        int status = 0;
        int sent = 0;
        Verdict result;
        {
            const ScopedRunOptions watched(Reporting());
            sent = rsyncer.FinishSync(completed ? "share" : "abort", share, status);
        }
        heard = !cancel || (sent == 0 && status == kDone);
        if (completed && (sent != 0 || status != kDone)) {
            result = Failed("the server does not confirm " + Quoted(share), status);
        }
        report = of_the_run;
        return result;
    }

    Verdict ListShare(const RunOrder& order, const ShareOrder& share,
                      const ChangeHandler& on_change,
                      const std::function<void(const std::string&)>& on_missing) {
        for (const std::string& path : share.paths) {
            RunOptions wishes = Reporting();
            wishes.dry_run = true;
            wishes.on_change = [&](const RunChange& change) { on_change(share.share, change); };
            int status = 0;
            const ScopedRunOptions watched(std::move(wishes));
            const int ran =
                rsyncer.RunSync(order.task_id, share.share, path, ToList(order.excludes), status);
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
    RunReport report;         // of the last thing that was run
    uint64_t rsync_runs = 0;  // copies made
    bool heard = true;        // the server still listens when a person has had enough
    ZEL::Rsyncer rsyncer;
};

TaskRun::TaskRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel, RunListener listener)
    : impl_(std::make_unique<Impl>(info, cancel, std::move(listener))) {}

TaskRun::~TaskRun() = default;

Verdict TaskRun::Connect() {
    const CancelScope scope(impl_->cancel);
    const ScopedRunOptions watched(impl_->Reporting());
    const int status = impl_->rsyncer.Initialize(impl_->info);
    const std::string& name = impl_->info.GetServerName();
    return status == 0 ? Verdict()
                       : impl_->Failed("cannot use server " +
                                           (name.empty() ? impl_->info.GetServerIP() : name),
                                       status);
}

Verdict TaskRun::CheckPairing(const std::vector<std::string>& shares) {
    const CancelScope scope(impl_->cancel);
    return impl_->Pair(true, shares);
}

Verdict TaskRun::Push(const RunOrder& order, RunTotals& totals) {
    const CancelScope scope(impl_->cancel);
    std::vector<std::string> names;
    for (const ShareOrder& share : order.shares) {
        names.push_back(share.share);
    }
    impl_->rsync_runs = 0;
    impl_->heard = true;
    int ignored = 0;
    bool announced = order.announce;
    Verdict result;
    {
        Beacon beacon(impl_->rsyncer.GetSyncInfo(), order.task);
        if (announced) {
            impl_->rsyncer.SendBeacon(order.task, ignored);
        }
        for (const ShareOrder& share : order.shares) {
            result = impl_->PushShare(order, share, names, totals);
            if (!result.Ok()) {
                break;
            }
        }
        announced = beacon.Stop() || announced;
    }
    totals.rsync_runs += impl_->rsync_runs;
    if (announced && impl_->heard) {
        const LastWord last_word;
        impl_->rsyncer.FinishSync("task", order.task, ignored);
    }
    return result;
}

Verdict TaskRun::List(const RunOrder& order, const ChangeHandler& on_change,
                      const std::function<void(const std::string& share)>& on_missing) {
    const CancelScope scope(impl_->cancel);
    for (const ShareOrder& share : order.shares) {
        Verdict result = impl_->ListShare(order, share, on_change, on_missing);
        if (!result.Ok()) {
            return result;
        }
    }
    return {};
}

}  // namespace programs
