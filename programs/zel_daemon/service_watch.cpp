// The service's watch: which folders, and which tasks are notified.
#include <algorithm>
#include <cerrno>
#include <utility>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "programs/common/host.h"
#include "programs/common/mounts_below.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service.h"
#include "programs/zel_daemon/shortage.h"

namespace zel_daemon {

namespace {

using ZEL::Logger;

// The watcher's share of the loop's time before others have their turn.
constexpr std::chrono::milliseconds kWatcherSlice(20);

std::string ShownShare(const std::string& share) {
    return "share '" + programs::Printable(share) + "': ";
}

// Why a share could not be looked up.
std::string WhyUnknown(const std::string& share) {
    const std::string problem = ShareProblem(share);
    return problem.empty() ? ShownShare(share) + "it cannot be looked up" : problem;
}

// A path may be longer than what a person reads.
std::string Shortened(const std::string& path) {
    constexpr size_t kShown = 200;
    return programs::Printable(path.substr(0, kShown)) + (path.size() > kShown ? "..." : "");
}

std::string WhyUnwatched(int error) {
    switch (error) {
        case ENOSPC:
            return "raise fs.inotify.max_user_watches";
        case EUSERS:
            return "no inotify instance is left (raise fs.inotify.max_user_instances)";
        default:
            return ReasonOf(error);
    }
}

}  // namespace

// Whenever shares are to be scanned: an instance may be had by now.
void Service::ListenToWatcher() {
    if (!watcher_heard_ && watcher_.Open()) {
        watcher_heard_ = true;
        loop_.OnReadable(watcher_.Fd(), [this] { RunWatcher(); });
    }
}

// Makes the watcher watch what the tasks need, where it is now.
void Service::WatchShares() {
    ListenToWatcher();
    for (auto& [name, share] : shares_) {
        share.tasks.clear();
    }
    for (auto& [id, task] : tasks_) {
        if (task.machine.Watches()) {
            for (const std::string& name : task.machine.Record().Info().GetShareList()) {
                shares_[name].tasks.push_back(&task);
            }
        }
    }
    for (auto at = shares_.begin(); at != shares_.end();) {
        const std::string& name = at->first;
        WatchedShare& share = at->second;
        if (share.tasks.empty()) {
            watcher_.Remove(name);
            at = shares_.erase(at);
            continue;
        }
        ++at;
        ZEL::ShareInfo facts;
        const bool known = ZEL::GetShareInfo(name, facts) == 0;
        const bool is_elsewhere = !share.folder.empty() && !IsAtItsPlace(name);
        if (is_elsewhere && !known) {  // another folder, or none
            watcher_.Remove(name);
            share.folder.clear();
        }
        if (known && (facts.GetModulePath() != share.folder || is_elsewhere)) {
            share.folder = facts.GetModulePath();
            share.path = share.folder;
            share.place = {};
            stat(share.path.c_str(), &share.place);
            share.problem.clear();
            share.mounts.reset();
            watcher_.Add(name, share.folder);
            for (Task* const task : share.tasks) {
                task->machine.Watched(name);
            }
        } else if (!share.problem.empty()) {
            for (Task* const task : share.tasks) {  // some may be new to it
                if (task->machine.Unwatched().count(name) == 0) {
                    task->machine.Lost(name, true);
                }
            }
        } else if (!known && share.folder.empty()) {  // else it is no news of the folder
            LoseForLong(name, WhyUnknown(name));
        }
    }
    LookAtMounts();
    std::set<std::string> paths;
    for (const auto& [name, share] : shares_) {
        if (!share.path.empty()) {
            paths.insert(share.path);
        }
    }
    places_.Set(paths);
    PostWatcher();
}

// Whether the path of a share still leads to the folder that is watched.
bool Service::IsAtItsPlace(const std::string& share) const {
    const WatchedShare& watched = shares_.at(share);
    struct stat now = {};
    return stat(watched.folder.c_str(), &now) == 0 && now.st_dev == watched.place.st_dev &&
           now.st_ino == watched.place.st_ino;
}

// A disk that is mounted or unmounted below a share changes what is to be seen there, and not a
// single file: the kernel notifies of nothing.
void Service::LookAtMounts() {
    try {
        const programs::MountTable table;
        for (auto& [name, share] : shares_) {
            if (share.folder.empty()) {
                continue;
            }
            std::vector<std::string> mounts = table.Below(share.folder);
            if (share.mounts && *share.mounts != mounts) {
                watcher_.Rescan(name);
                for (Task* const task : share.tasks) {
                    task->machine.Lost(name, false);
                }
            }
            share.mounts = std::move(mounts);
        }
    } catch (const programs::Failure& failure) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                       failure.what());
    }
}

// A share that could not be watched, because its folder was away, may be there again.
void Service::WatchAgain(const Task& task) {
    const std::set<std::string>& shares = task.machine.Unwatched();
    if (std::any_of(shares.begin(), shares.end(), [this](const std::string& share) {
            return shares_.at(share).folder.empty();
        })) {
        WatchShares();
    }
}

void Service::PostWatcher() {
    if (!watcher_posted_) {
        watcher_posted_ = true;
        loop_.Post([this] {
            watcher_posted_ = false;
            RunWatcher();
        });
    }
}

void Service::RunWatcher() {
    if (watcher_.Work(kWatcherSlice)) {
        PostWatcher();
    } else {
        for (auto& [id, task] : tasks_) {
            task.machine.HeardAll();
        }
    }
    Advance();
}

void Service::OnChange(const std::string& share, const std::string& path) {
    for (Task* const task : shares_.at(share).tasks) {
        task->machine.Changed(share, path);
    }
}

void Service::OnMove(const std::string& share, const std::string& from, const std::string& to) {
    for (Task* const task : shares_.at(share).tasks) {
        task->machine.Moved(share, from, to);
    }
}

void Service::OnLoss(const std::string& share, const WatchLoss& loss) {
    const std::string shown = ShownShare(share);
    const std::string often = "; what changes there is looked for every " +
                              programs::HumanDuration(static_cast<uint64_t>(config_.poll.count()));
    switch (loss.kind) {
        case WatchLoss::kOverflow:  // scanned anew by the watcher itself
            Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                           (shown + "too many changes at once; they are looked for").c_str());
            for (Task* const task : shares_.at(share).tasks) {
                task->machine.Lost(share, false);
            }
            break;
        case WatchLoss::kUnwatched:
            LoseForLong(share, shown +
                                   (loss.path == "/" ? "its folders cannot be watched"
                                                     : "not all of its folders can be watched ('" +
                                                           Shortened(loss.path) + "')") +
                                   ": " + WhyUnwatched(loss.error) + often);
            break;
        case WatchLoss::kFolderGone:
            shares_.at(share).folder.clear();
            LoseForLong(share,
                        shown + "its folder has gone; nothing is deleted at the server" + often);
            break;
    }
}

// Not all of a share is watched, and people should know why.
void Service::LoseForLong(const std::string& share, const std::string& problem) {
    WatchedShare& lost = shares_.at(share);
    if (lost.problem != problem) {
        lost.problem = problem;
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                       problem.c_str());
    }
    for (Task* const task : lost.tasks) {
        task->machine.Lost(share, true);
    }
}

void Service::Rescan(Task& task) {
    task.machine.Rescanned();
    ListenToWatcher();
    for (const std::string& share : task.machine.Unwatched()) {
        watcher_.Rescan(share);
    }
    PostWatcher();
}

bool Service::IsCovered(const std::string& share) const {
    return !shares_.at(share).folder.empty() && watcher_.Stats(share).complete;
}

// What could not be watched may be watched since: a folder was made readable, a limit was raised.
void Service::ForgetSettledProblems(const Task& task) {
    const std::set<std::string> unwatched = task.machine.Unwatched();
    for (const std::string& name : unwatched) {
        if (IsCovered(name)) {
            WatchedShare& share = shares_.at(name);
            share.problem.clear();
            for (Task* const watching : share.tasks) {
                watching->machine.Covered(name);
            }
        }
    }
}

}  // namespace zel_daemon
