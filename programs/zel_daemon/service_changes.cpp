// The service's changes on disk: what is watched, and what becomes of what is told.
#include <algorithm>
#include <iterator>
#include <utility>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/service_task.h"

namespace zel_daemon {

namespace {

using ZEL::Logger;

// The watcher's share of the loop's time before others have their turn.
constexpr std::chrono::milliseconds kWatcherSlice(20);

}  // namespace

// Makes the watcher watch what the realtime tasks need, where it is now.
void Service::WatchShares() {
    std::map<std::string, std::string> needed;
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches()) {
            continue;
        }
        for (const std::string& share : task->record.Info().GetShareList()) {
            ZEL::ShareInfo facts;
            if (needed.count(share) == 0 && ZEL::GetShareInfo(share, facts) == 0) {
                needed[share] = facts.GetModulePath();
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
                if (task->HasShare(share)) {
                    task->whole_due = task->Watches();
                    task->notes.erase(share);
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

bool Service::IsSearching(const Task& task) const {
    const std::list<std::string>& shares = task.record.Info().GetShareList();
    return std::any_of(shares.begin(), shares.end(), [this](const std::string& share) {
        return watcher_.Stats(share).searching;
    });
}

void Service::OnChange(const std::string& share, const std::string& path) {
    const int64_t now = clock_.Elapsed();
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches() || !task->HasShare(share)) {
            continue;
        }
        task->gathered[share].Add(path);
        task->gather_first = task->gather_first.value_or(now);
        task->gather_last = now;
        task->held = false;
    }
}

void Service::OnLoss(const std::string& share, WatchLoss loss) {
    const std::string shown = "share '" + programs::Printable(share) + "': ";
    const std::string often = "; it is compared whole every " +
                              programs::HumanDuration(static_cast<uint64_t>(config_.poll.count()));
    std::string note;
    switch (loss) {
        case WatchLoss::kOverflow:
            break;  // searched anew, and compared whole once
        case WatchLoss::kWatchLimit:
            note = shown +
                   "not all of its folders can be watched (raise fs.inotify.max_user_watches)" +
                   often;
            break;
        case WatchLoss::kUnreadable:
            note = shown + "some of its folders cannot be read, and are not watched" + often;
            break;
        case WatchLoss::kFolderGone:
            note = shown + "its folder has gone; nothing is deleted at the server" + often;
            watched_.erase(share);
            break;
    }
    Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] zel_daemon(%d): %s\n", __LINE__,
                   note.empty() ? (shown + "too many changes at once; it is compared whole").c_str()
                                : note.c_str());
    for (const auto& [id, task] : tasks_) {
        if (!task->Watches() || !task->HasShare(share)) {
            continue;
        }
        task->whole_due = true;
        task->held = false;
        if (!note.empty()) {
            task->notes[share] = note;
            task->poll_at = clock_.Elapsed() + config_.poll.count() * 1000;
        }
    }
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
