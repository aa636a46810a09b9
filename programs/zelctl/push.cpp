#include "programs/zelctl/push.h"

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <mutex>
#include <thread>

#include "ZEL/rsyncer.h"
#include "programs/common/server_status.h"
#include "programs/common/text.h"
#include "programs/zelctl/interrupt.h"
#include "programs/zelctl/prepare.h"
#include "programs/zelctl/progress.h"
#include "programs/zelctl/shares.h"

namespace zelctl {

namespace {

using TARQ::Backup::RunChange;
using TARQ::Backup::RunOptions;
using TARQ::Backup::RunProgress;
using TARQ::Backup::RunReport;
using TARQ::Backup::ScopedRunOptions;

constexpr std::chrono::seconds kBeaconEvery(60);  // the server takes a task for dead after 120
constexpr int kVanishedFiles = 24;  // rsync: some files were gone before it came to them

std::list<std::string> ToList(const std::vector<std::string>& items) {
    return {items.begin(), items.end()};
}

/// Tells the server that the push is alive, from a thread and a connection of its own.
class Beacon {
public:
    Beacon(const ZEL::SyncInfo& info, std::string task) : info_(info), task_(std::move(task)) {
        thread_ = std::thread([this] { Run(); });
    }
    ~Beacon() {
        {
            const std::lock_guard<std::mutex> lock(mutex_);
            stop_ = true;
        }
        wake_.notify_one();
        thread_.join();
    }
    Beacon(const Beacon&) = delete;
    Beacon& operator=(const Beacon&) = delete;

private:
    void Run() {
        ZEL::Rsyncer rsyncer;
        rsyncer.SetCancelChecker(Interrupted);
        bool ready = false;
        std::unique_lock<std::mutex> lock(mutex_);
        while (!wake_.wait_for(lock, kBeaconEvery, [this] { return stop_; })) {
            lock.unlock();
            // A beacon that fails is no reason to end the push.
            ready = ready || rsyncer.Initialize(info_) == 0;
            int status = 0;
            if (ready) {
                rsyncer.SendBeacon(task_, status);
            }
            lock.lock();
        }
    }

    ZEL::SyncInfo info_;
    std::string task_;
    std::mutex mutex_;
    std::condition_variable wake_;
    bool stop_ = false;
    std::thread thread_;
};

/// One push: the connection and what has been said of it.
class Pusher {
public:
    explicit Pusher(const PushOptions& options) : options_(options), display_(options.quiet) {
        rsyncer_.SetCancelChecker(Interrupted);
    }

    /// Finds the server and asks whether it would take the shares. Changes nothing there.
    ExitCode Connect() {
        ExitCode result = PrepareHost();
        if (result == kOk) {
            result = CheckShares(options_.shares);
        }
        ZEL::SyncInfo info = options_.info.value_or(ZEL::SyncInfo());
        if (result == kOk && !options_.info) {
            result = options_.connection.ToSyncInfo(info);
        }
        if (result != kOk) {
            return result;
        }
        WatchForInterrupt();
        {
            const ScopedRunOptions watched(Reporting());
            const int status = rsyncer_.Initialize(info);
            if (status != 0) {
                return Failed("cannot use server " + options_.connection.server, status);
            }
        }
        return Pair(true);
    }

    /// Asks the server for these shares; `dry_run`: would it take them?
    ExitCode Pair(bool dry_run) {
        std::list<std::string> conflicts;
        int status = 0;
        const ScopedRunOptions watched(Reporting());
        if (rsyncer_.DoPairing(dry_run, ToList(options_.shares), conflicts, status) != 0) {
            return Failed("the server does not take these shares", status);
        }
        for (const std::string& share : conflicts) {
            Fail(kRefused, "share '%s' belongs to another client or account at the server",
                 programs::Printable(share).c_str());
        }
        return status == programs::kDone ? kOk : kRefused;
    }

    ExitCode PushAll() {
        const std::string task = "push-" + ZEL::GetHostName(35);
        int ignored = 0;
        ExitCode result = kOk;
        {
            const Beacon beacon(rsyncer_.GetSyncInfo(), task);
            rsyncer_.SendBeacon(task, ignored);
            for (const std::string& share : options_.shares) {
                result = PushShare(share);
                if (result != kOk) {
                    break;
                }
            }
        }
        rsyncer_.SetCancelChecker(
            nullptr);  // the last word is sent even when the user has had enough
        rsyncer_.FinishSync("task", task, ignored);
        return result;
    }

    ExitCode ListAll() {
        for (const std::string& share : options_.shares) {
            const ExitCode result = ListChanges(share);
            if (result != kOk) {
                return result;
            }
        }
        return kOk;
    }

private:
    RunOptions Reporting() {
        RunOptions wishes;
        report_ = RunReport();
        wishes.report = &report_;
        return wishes;
    }

    ExitCode Failed(const std::string& what, int status) {
        display_.Clear();
        if (Interrupted()) {
            return Fail(kCancelled, "ended by the user; the next push completes the copy");
        }
        const std::string why = status == 0 ? "see the system log" : Explain(status, report_);
        return Fail(status == 0 ? kLocal : CodeOf(status), "%s: %s", what.c_str(), why.c_str());
    }

    // Announces a share, and pairs first when the server does not know this client.
    ExitCode Start(const std::string& share) {
        for (const bool may_pair : {true, false}) {
            int status = 0;
            {
                const ScopedRunOptions watched(Reporting());
                if (rsyncer_.StartSyncShare(share, status) != 0) {
                    return Failed("share '" + share + "' cannot be announced", 0);
                }
            }
            if (status == programs::kNotPaired && may_pair) {
                const ExitCode paired = PairForReal();
                if (paired != kOk) {
                    return paired;
                }
                continue;
            }
            return status == programs::kDone
                       ? kOk
                       : Failed("the server does not take share '" + share + "'", status);
        }
        return kOk;
    }

    ExitCode PairForReal() {
        const ExitCode paired = Pair(false);
        if (paired == kOk && !options_.quiet) {
            printf("Paired with %s.\n", rsyncer_.GetLatestIP().c_str());
        }
        return paired;
    }

    ExitCode SendKey(const std::string& share) {
        const ScopedRunOptions watched(Reporting());
        const int status = rsyncer_.SyncEncryptKey(share);
        return status == 0
                   ? kOk
                   : Failed("the key of encrypted share '" + share + "' cannot be sent", status);
    }

    ExitCode PushShare(const std::string& share) {
        ExitCode result = Start(share);
        if (result == kOk) {
            result = SendKey(share);
        }
        if (result != kOk) {
            return result;
        }
        const auto begin = std::chrono::steady_clock::now();
        // Once more, right before files are compared: an unmounted volume must not look like an
        // emptied share.
        result = CheckShares({share});
        if (result == kOk) {
            result = SendFiles(share);
        }
        const std::chrono::duration<double> elapsed = std::chrono::steady_clock::now() - begin;
        const RunReport sent = report_;
        const ExitCode closed = Finish(share, result == kOk);
        if (result == kOk && closed == kOk && !options_.quiet) {
            printf("%s: %s\n", programs::Printable(share).c_str(),
                   Summary(sent, elapsed.count()).c_str());
        }
        return result != kOk ? result : closed;
    }

    ExitCode SendFiles(const std::string& share) {
        RunOptions wishes = Reporting();
        wishes.bandwidth_limit = options_.bandwidth_limit;
        if (!options_.quiet) {
            wishes.on_progress = [&](const RunProgress& progress) {
                display_.Show(share, progress);
            };
        }
        int status = 0;
        const ScopedRunOptions watched(std::move(wishes));
        const int ran =
            rsyncer_.RunSync(0, share, options_.path, ToList(options_.excludes), status);
        display_.Clear();
        if (ran == 0 && status == 0 && report_.status != 0) {
            return Fail(kLocal, "share '%s' has no %s", programs::Printable(share).c_str(),
                        programs::Printable(options_.path).c_str());
        }
        if (ran == 0 && status == kVanishedFiles) {
            fprintf(stderr,
                    "zelctl: share '%s': some files vanished while they were being pushed\n",
                    share.c_str());
            return kOk;
        }
        return ran == 0 && status == 0 ? kOk
                                       : Failed("share '" + share + "' is not complete", status);
    }

    ExitCode Finish(const std::string& share, bool completed) {
        int status = 0;
        const RunReport of_the_run = report_;
        rsyncer_.SetCancelChecker(nullptr);
        const ScopedRunOptions watched(Reporting());
        const int sent = rsyncer_.FinishSync(completed ? "share" : "abort", share, status);
        rsyncer_.SetCancelChecker(Interrupted);
        if (!completed) {
            return kOk;  // the failure itself has been told
        }
        return sent == 0 && status == programs::kDone
                   ? kOk
                   : Failed("the server does not confirm share '" + share + "'", status);
    }

    ExitCode ListChanges(const std::string& share) {
        RunOptions wishes = Reporting();
        wishes.dry_run = true;
        uint64_t sends = 0;
        uint64_t bytes = 0;
        uint64_t deletes = 0;
        wishes.on_change = [&](const RunChange& change) {
            const std::string path = programs::Printable(change.path);
            if (change.kind == RunChange::SEND) {
                printf("send    %s (%s)\n", path.c_str(),
                       programs::HumanBytes(change.length).c_str());
                ++sends;
                bytes += change.length;
            } else if (change.kind == RunChange::DELETE) {
                printf("delete  %s\n", path.c_str());
                ++deletes;
            }
        };
        int status = 0;
        int ran = 0;
        {
            const ScopedRunOptions watched(std::move(wishes));
            ran = rsyncer_.RunSync(0, share, options_.path, ToList(options_.excludes), status);
        }
        if (ran == 0 && status != 0 && report_.cause == TARQ::Backup::RunCause::UNKNOWN_MODULE) {
            printf("%s: the server holds no copy yet; all of it would be sent.\n", share.c_str());
            return kOk;
        }
        if (ran != 0 || (status != 0 && status != kVanishedFiles)) {
            return Failed("share '" + share + "' cannot be compared", status);
        }
        printf("%s: %s (%s) would be sent, %llu deleted.\n", programs::Printable(share).c_str(),
               programs::Count(sends, "file").c_str(), programs::HumanBytes(bytes).c_str(),
               static_cast<unsigned long long>(deletes));
        return kOk;
    }

    const PushOptions& options_;
    ProgressDisplay display_;
    RunReport report_;
    ZEL::Rsyncer rsyncer_;
};

}  // namespace

ExitCode Push(const PushOptions& options) {
    Pusher pusher(options);
    const ExitCode result = pusher.Connect();
    if (result != kOk) {
        return result;
    }
    return options.dry_run ? pusher.ListAll() : pusher.PushAll();
}

ExitCode CheckPairing(const ConnectionOptions& connection, const std::vector<std::string>& shares) {
    PushOptions options;
    options.connection = connection;
    options.shares = shares;
    Pusher pusher(options);
    const ExitCode result = pusher.Connect();
    if (result == kOk) {
        puts("The server would take these shares from this client.");
    }
    return result;
}

}  // namespace zelctl
