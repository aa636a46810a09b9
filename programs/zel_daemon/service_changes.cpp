// The service's changes on disk: what is watched, and what becomes of what is told.
#include <algorithm>
#include <cerrno>
#include <iterator>
#include <utility>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "programs/common/task_run.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service_task.h"
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

// Whenever shares are to be searched: an instance may be had by now.
void Service::ListenToWatcher() {
    if (!watcher_heard_ && watcher_.Open()) {
        watcher_heard_ = true;
        loop_.OnReadable(watcher_.Fd(), [this] { RunWatcher(); });
    }
}

// Makes the watcher watch what the realtime tasks need, where it is now.
void Service::WatchShares() {
    ListenToWatcher();
    std::map<std::string, std::string> needed;
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches()) {
            continue;
        }
        for (const std::string& share : task->record.Info().GetShareList()) {
            ZEL::ShareInfo facts;
            if (needed.count(share) != 0) {
                continue;
            }
            if (ZEL::GetShareInfo(share, facts) == 0) {
                needed[share] = facts.GetModulePath();
            } else if (watched_.count(share) != 0) {
                needed[share] = watched_[share];  // a look-up that fails is no news of its folder
            } else if (task->notes.count(share) == 0) {
                Note(share, WhyUnknown(share));
            }
        }
    }
    for (const auto& [share, folder] : watched_) {
        if (needed.count(share) == 0) {
            watcher_.Remove(share);
        }
    }
    for (const auto& [share, folder] : needed) {
        const auto before = watched_.find(share);
        if (before == watched_.end() || before->second != folder) {
            watcher_.Add(share, folder);
            for (const auto& [id, task] : tasks_) {
                if (task->debts.Has(share)) {
                    task->notes.erase(share);
                    if (task->Watches()) {
                        task->debts.OweWhole(share);
                    }
                }
            }
        }
    }
    watched_ = std::move(needed);
    PostWatcher();
}

// A share that could not be watched, because its folder was away, may be there again.
void Service::WatchAgain(const Task& task) {
    const std::list<std::string>& shares = task.record.Info().GetShareList();
    if (task.Watches() &&
        std::any_of(shares.begin(), shares.end(),
                    [this](const std::string& share) { return watched_.count(share) == 0; })) {
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
    }
    Advance();
}

std::optional<TaskWatch> Service::WatchOf(const Task& task) const {
    if (!task.Watches()) {
        return std::nullopt;
    }
    TaskWatch watch;
    for (const std::string& share : task.record.Info().GetShareList()) {
        const WatchStats stats = watcher_.Stats(share);
        const bool known = watched_.count(share) != 0;
        watch.folders += stats.folders;
        watch.searching = watch.searching || stats.searching;
        if (known && stats.complete && (stats.folders > 0 || stats.searching)) {
            continue;
        }
        watch.complete = false;
        const auto note = task.notes.find(share);
        watch.problem += (watch.problem.empty() ? "" : "; ") +
                         (note != task.notes.end() ? note->second
                                                   : "share '" + programs::Printable(share) +
                                                         "': its folder is not watched");
    }
    return watch;
}

void Service::OnChange(const std::string& share, const std::string& path) {
    const int64_t now = clock_.Elapsed();
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches() || !task->debts.Has(share)) {
            continue;
        }
        task->gathered[share].Add(path);
        task->gather_first = task->gather_first.value_or(now);
        task->gather_last = now;
        task->held = false;
    }
}

// What a person should know of a share that is not watched in full.
void Service::Note(const std::string& share, const std::string& note) {
    bool is_news = false;
    for (const auto& [id, task] : tasks_) {
        if (task->Watches() && task->debts.Has(share) && task->notes[share] != note) {
            task->notes[share] = note;
            is_news = true;
        }
    }
    if (is_news) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                       note.c_str());
    }
}

void Service::OnLoss(const std::string& share, const WatchLoss& loss) {
    const std::string shown = ShownShare(share);
    const std::string often = "; it is compared whole every " +
                              programs::HumanDuration(static_cast<uint64_t>(config_.poll.count()));
    switch (loss.kind) {
        case WatchLoss::kOverflow:  // searched anew, and compared whole once
            Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                           (shown + "too many changes at once; it is compared whole").c_str());
            break;
        case WatchLoss::kUnwatched:
            Note(share, shown +
                            (loss.path == "/" ? "its folders cannot be watched"
                                              : "not all of its folders can be watched ('" +
                                                    Shortened(loss.path) + "')") +
                            ": " + WhyUnwatched(loss.error) + often);
            break;
        case WatchLoss::kFolderGone:
            Note(share, shown + "its folder has gone; nothing is deleted at the server" + often);
            watched_.erase(share);
            break;
    }
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches() || !task->debts.Has(share)) {
            continue;
        }
        task->debts.OweWhole(share);
        task->held = false;
        if (loss.kind != WatchLoss::kOverflow) {
            task->poll_at = clock_.Elapsed() + config_.poll.count() * 1000;
        }
    }
}

bool Service::PollDue(const Task& task) const {
    return !task.active && !task.held && !task.plan->RetryWaiting() && task.poll_at &&
           clock_.Elapsed() >= *task.poll_at;
}

// What is not watched is compared whole now and then, after another try to watch it.
void Service::SearchAgain(Task& task) {
    task.poll_at = clock_.Elapsed() + config_.poll.count() * 1000;
    ListenToWatcher();
    for (const auto& [share, note] : task.notes) {
        task.debts.OweWhole(share);
        watcher_.SearchAgain(share);
    }
    PostWatcher();
}

// What could not be watched may be watched since: a folder was made readable, a share came back.
void Service::ForgetSettledNotes(Task& task) {
    for (auto note = task.notes.begin(); note != task.notes.end();) {
        const bool settled =
            watched_.count(note->first) != 0 && watcher_.Stats(note->first).complete;
        note = settled ? task.notes.erase(note) : std::next(note);
    }
    if (task.notes.empty()) {
        task.poll_at.reset();
    }
}

bool Service::GatherDue(const Task& task, int64_t now) const {
    return task.HasGathered() && now >= task.store_retry_at &&
           (now - task.gather_last >= config_.gather.count() ||
            now - *task.gather_first >= config_.gather_max.count());
}

void Service::StoreGathered(Task& task) {
    for (auto& [share, changes] : task.gathered) {
        const std::vector<std::string> paths = changes.Take();
        try {
            store_.AddEvents(task.record.ID(), share, paths);
            task.debts.OweChanges(share);
        } catch (const StoreError&) {
            for (const std::string& path : paths) {
                changes.Add(path);
            }
            throw;
        }
    }
    task.gathered.clear();
    task.gather_first.reset();
    task.store_note.clear();
    task.pending = store_.CountEvents(task.record.ID());
}

}  // namespace zel_daemon
