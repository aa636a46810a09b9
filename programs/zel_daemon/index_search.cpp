#include "programs/zel_daemon/index_search.h"

#include <algorithm>
#include <chrono>
#include <thread>
#include <utility>

#include "base/background_priority.h"
#include "programs/zel_daemon/index_walk.h"
#include "programs/zel_daemon/path_key.h"
#include "programs/zel_daemon/shortage.h"
#include "programs/zel_daemon/tree_list.h"

namespace zel_daemon {

namespace {

using Found = TreeList::Found;

// So many paths are handed over at a time, and so many such parts wait at most for a busy loop.
constexpr size_t kTogether = 256;
constexpr int kMostWaiting = 16;
constexpr std::chrono::milliseconds kWait(5);

bool IsAtTheTop(const std::string& path) {
    return path.size() > 1 && path.rfind('/', path.size() - 2) == 0;
}

class Comparison {
public:
    Comparison(FileIndex& index, const std::string& folder, const std::function<bool()>& cancelled,
               const std::function<void(const std::string& path)>& on_change)
        : list_(folder, "/", cancelled),
          known_(index),
          cancelled_(cancelled),
          on_change_(on_change) {}

    void Run() {
        ReadEntry();
        while (!cancelled_() && (is_there_ || known_.Entry() != nullptr)) {
            const IndexEntry* const known = known_.Entry();
            const int order = !is_there_ ? 1 : known == nullptr ? -1 : key_.compare(known->key);
            LeaveFolders(order <= 0 ? key_ : known->key);
            if (order > 0) {
                Gone();
            } else if (order < 0) {
                New();
            } else {
                Both(known->facts);
            }
        }
        if (!cancelled_()) {
            LeaveFolders("");
            LeaveShare();
        }
    }

private:
    /// A folder that is another than it was, though nothing in it has been told yet.
    struct Folder {
        std::string key;
        std::string inside;  // a path below it that can be sent in its place; empty: none so far
    };

    void ReadEntry() {
        Found found = list_.Next(entry_);
        for (; found == Found::kUnreadable; found = list_.Next(entry_)) {
            Tell(entry_.path);  // what is wrong with it, the run will say
            known_.SkipBelow(KeyOf(entry_.path));
        }
        is_there_ = found == Found::kEntry;
        if (is_there_) {
            key_ = KeyOf(entry_.path);
            CountAtTheTop();
        }
    }

    // Which entry of the share's folder has the least in it.
    void CountAtTheTop() {
        if (IsAtTheTop(entry_.path)) {
            TakeSmallest();
            top_ = entry_.path;
            top_entries_ = 0;
        }
        ++top_entries_;
    }
    void TakeSmallest() {
        if (!top_.empty() && (smallest_.empty() || top_entries_ < smallest_entries_)) {
            smallest_ = top_;
            smallest_entries_ = top_entries_;
        }
    }

    void Gone() {
        const IndexEntry known = *known_.Entry();
        Tell(PathOf(known.key) + (known.facts.IsFolder() ? "/" : ""));
        known_.SkipBelow(known.key);
    }

    void New() {
        Tell(entry_.path);
        list_.Skip();
        ReadEntry();
    }

    void Both(const EntryFacts& known) {
        const bool was_folder = known.IsFolder();
        const bool is_folder = entry_.facts.IsFolder();
        const bool unchanged = IsUnchanged(known, entry_.facts);
        if (was_folder != is_folder) {
            Tell(entry_.path + (was_folder ? "/" : ""));
            list_.Skip();
            known_.SkipBelow(key_);
            ReadEntry();
            return;
        }
        if (!is_folder && unchanged) {
            for (auto folder = folders_.rbegin();
                 folder != folders_.rend() && folder->inside.empty(); ++folder) {
                folder->inside = entry_.path;
            }
        } else if (!is_folder) {
            Tell(entry_.path);
        } else if (!unchanged && entry_.path == "/") {
            share_is_other_ = true;
        } else if (!unchanged) {
            folders_.push_back({key_, ""});
        }
        known_.Next();
        ReadEntry();
    }

    // The folders above come along with what is told, but the share's own with what is in it alone.
    void Tell(const std::string& path) {
        folders_.clear();
        share_is_other_ = share_is_other_ && !IsAtTheTop(path) && path != "/";
        on_change_(path);
    }

    // Those that do not hold the key have been looked at in full.
    void LeaveFolders(const std::string& key) {
        while (!folders_.empty() && !IsWithin(key, folders_.back().key)) {
            const Folder folder = folders_.back();
            Tell(folder.inside.empty() ? PathOf(folder.key) : folder.inside);
        }
    }

    void LeaveShare() {
        TakeSmallest();
        if (share_is_other_) {
            Tell(smallest_.empty() ? "/" : smallest_);
        }
    }

    TreeList list_;
    IndexWalk known_;
    const std::function<bool()>& cancelled_;
    const std::function<void(const std::string& path)>& on_change_;
    TreeList::Entry entry_;        // that the list has given last
    std::string key_;              // its key
    bool is_there_ = false;        // the list has not come to its end
    std::vector<Folder> folders_;  // each within the one before
    bool share_is_other_ = false;  // its own folder, and nothing in that has been told
    std::string top_;              // the entry of the share's folder that is being looked at
    uint64_t top_entries_ = 0;
    std::string smallest_;
    uint64_t smallest_entries_ = 0;
};

}  // namespace

void FindChanges(FileIndex& index, const std::string& folder,
                 const std::function<bool()>& cancelled,
                 const std::function<void(const std::string& path)>& on_change) {
    Comparison(index, folder, cancelled, on_change).Run();
}

IndexSearch::IndexSearch(EventLoop& loop, SearchOrder order, const OnChanges& on_changes,
                         const OnEnd& on_end)
    : order_(std::move(order)), worker_(loop) {
    worker_.Start<SearchOutcome>([this, on_changes] { return Work(on_changes); },
                                 [](const std::string& why) {
                                     SearchOutcome outcome;
                                     outcome.problem = why;
                                     return outcome;
                                 },
                                 on_end);
}

void IndexSearch::Tell(const OnChanges& on_changes, std::vector<std::string> paths) {
    while (waiting_ >= kMostWaiting && !cancel_) {
        std::this_thread::sleep_for(kWait);
    }
    ++waiting_;
    worker_.Tell([this, on_changes, found = std::move(paths)] {
        --waiting_;
        on_changes(found);
    });
}

SearchOutcome IndexSearch::Work(const OnChanges& on_changes) {
    base::GiveWay(0);
    SearchOutcome outcome;
    outcome.problem = ShareProblem(order_.share);
    if (!outcome.problem.empty()) {
        return outcome;
    }
    FileIndex index(order_.index);
    const std::optional<IndexStamp> stamp = index.Stamp();
    if (!stamp) {
        outcome.problem = "it is not known what its copy has";
        return outcome;
    }
    std::vector<std::string> paths;
    FindChanges(
        index, order_.folder, [this] { return cancel_.load(); },
        [&](const std::string& path) {
            ++outcome.changes;
            paths.push_back(path);
            if (paths.size() == kTogether) {
                Tell(on_changes, std::exchange(paths, {}));
            }
        });
    if (!paths.empty()) {
        Tell(on_changes, std::move(paths));
    }
    if (cancel_) {
        outcome.problem = "it was ended";
    }
    outcome.compared = stamp->compared;
    return outcome;
}

}  // namespace zel_daemon
