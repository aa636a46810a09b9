#include "programs/zel_daemon/watch_events.h"

#include <sys/inotify.h>
#include <sys/stat.h>

#include <algorithm>
#include <utility>

namespace zel_daemon {

namespace {

/// So few that the caller comes to other work meanwhile, and so many that the kernel's queue
/// (16,384 events unless set otherwise) does not overflow.
constexpr int kEventsPerTurn = 256;

/// The second event of a move follows the first at once unless another process came in between.
constexpr size_t kMovesInMind = 16;
/// It is written in the same call of the kernel: whoever reads very fast waits so long at most.
constexpr std::chrono::milliseconds kSecondEvent(2);
/// Behind the name of one of two entries that change places.
constexpr char kAside[] = ".exchanged";

std::string WithoutSlash(const std::string& path) {
    return path.substr(0, path.find_last_not_of('/') + 1);
}

bool IsThere(const std::string& path) {
    struct stat info;
    return lstat(path.c_str(), &info) == 0;
}

}  // namespace

void WatchEvents::Handle(const Inotify::Event& event) {
    if (!MayBeOfExchange(event)) {
        NotifyArrivals();
    }
    if (event.mask & IN_Q_OVERFLOW) {
        Overflow();
        return;
    }
    for (const FolderId id : tree_.table.WithWatch(event.watch)) {
        if (event.mask & IN_IGNORED) {
            WatchEnded(id);
        } else if (event.name.empty()) {
            FolderItself(id, event.mask);
        } else {
            Entry(id, event);
        }
    }
    if (event.mask & IN_MOVED_TO) {
        while (const auto left = TakeMove(event.cookie, std::nullopt)) {
            tree_.dropped.push_back(*left);
        }
        // To another share: there it has come, and here it has gone.
        const auto gone = std::stable_partition(
            leaving_.begin(), leaving_.end(),
            [&event](const Leaving& leaving) { return leaving.cookie != event.cookie; });
        const std::vector<Leaving> left(gone, leaving_.end());
        leaving_.erase(gone, leaving_.end());
        for (const Leaving& leaving : left) {
            NotifyLeaving(leaving);
        }
    }
}

void WatchEvents::Overflow() {
    DropMoves();
    std::vector<uint32_t> concerned;
    for (const auto& [number, share] : tree_.shares) {
        concerned.push_back(number);
    }
    for (const uint32_t number : concerned) {
        WatchedTree::Share* share = tree_.FindShare(number);
        if (share != nullptr && share->root != kNoFolder) {
            scan_.Enqueue(share->root, true);
            share->notified.clear();
            tree_.NotifyLoss(*share, {WatchLoss::kOverflow});
        }
    }
}

void WatchEvents::WatchEnded(FolderId id) {
    WatchedTree::Share* share = tree_.Locate(id);
    tree_.Unwatch(id);
    if (share != nullptr && id == share->root) {
        tree_.RootGone(*share);
    } else if (share != nullptr) {
        tree_.table[id].marks |= kNotified;
        scan_.Enqueue(id, false);
    }
}

void WatchEvents::FolderItself(FolderId id, uint32_t mask) {
    WatchedTree::Share* share = tree_.Locate(id);
    if (share == nullptr) {
        return;
    }
    if (mask & IN_ATTRIB) {
        if (id == share->root && (tree_.table[id].marks & kMissing) != 0) {
            scan_.Enqueue(id, true);
        }
        tree_.Notify(*share);
    } else if (id == share->root && (mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_UNMOUNT)) != 0) {
        tree_.RootGone(*share);
    } else if ((mask & IN_UNMOUNT) != 0) {
        tree_.Notify(*share, true);
    }  // else the folder's parent notifies
}

void WatchEvents::Entry(FolderId parent, const Inotify::Event& event) {
    WatchedTree::Share* share = tree_.Locate(parent);
    if (share == nullptr) {
        return;
    }
    bool with_content = false;
    if (event.mask & IN_ISDIR) {
        // What is deleted in a folder that is watched has been told, one by one.
        const FolderId id = tree_.table.Child(parent, event.name);
        const bool told = id != kNoFolder && tree_.table[id].watch >= 0;
        with_content =
            (event.mask & IN_MOVED_FROM) != 0 || ((event.mask & IN_DELETE) != 0 && !told);
        FolderEntry(parent, event);
    }
    tree_.path += '/';
    tree_.path += event.name;
    if (event.mask & IN_MOVED_FROM) {
        leaving_.push_back({event.cookie, tree_.table[parent].owner,
                            with_content ? tree_.path + "/" : tree_.path});
        if (leaving_.size() > kMovesInMind) {
            const Leaving first = leaving_.front();
            leaving_.erase(leaving_.begin());
            NotifyLeaving(first);
        }
        return;
    }
    const auto from = (event.mask & IN_MOVED_TO) != 0
                          ? TakeLeaving(event.cookie, tree_.table[parent].owner)
                          : std::nullopt;
    if (from) {
        Arrived({event.cookie, tree_.table[parent].owner, *from, tree_.path});
    } else {
        tree_.Notify(*share, with_content);
    }
}

void WatchEvents::FolderEntry(FolderId parent, const Inotify::Event& event) {
    FolderId id = tree_.table.Child(parent, event.name);
    if (event.mask & IN_MOVED_TO) {
        if (const auto moved = TakeMove(event.cookie, tree_.table[parent].owner)) {
            // Two folders that change places are told as if each came in the place of the other.
            // What could not be watched where it was may be at its new place.
            const WatchedTree::Share* const share = tree_.FindShare(tree_.table[parent].owner);
            const bool is_certain = id == kNoFolder && !tree_.is_ahead && share->missing == 0 &&
                                    tree_.table[*moved].watch >= 0;
            if (id != kNoFolder) {
                tree_.Drop(id);
            }
            tree_.table.Attach(*moved, parent, event.name);
            tree_.table[*moved].marks =
                static_cast<uint8_t>((tree_.table[*moved].marks & ~kUnseen) | kNotified);
            if (!is_certain) {
                scan_.Enqueue(*moved, true);
            }
            return;
        }
    }
    if (event.mask & (IN_CREATE | IN_MOVED_TO | IN_ATTRIB)) {
        if (id == kNoFolder) {
            id = tree_.AddChild(parent, event.name);
        }
        tree_.table[id].marks |= kNotified;
        // A change of its mode may have made it readable.
        if ((event.mask & IN_ATTRIB) == 0 || tree_.table[id].watch < 0) {
            scan_.Enqueue(id, false);
        }
    } else if (id != kNoFolder && (event.mask & IN_DELETE) != 0) {
        tree_.Drop(id);
    } else if (id != kNoFolder && (event.mask & IN_MOVED_FROM) != 0) {
        tree_.table.Detach(id);
        // When two folders changed places, the other one has this name now.
        scan_.Enqueue(tree_.AddChild(parent, event.name), false);
        moves_.push_back({event.cookie, id});
        if (moves_.size() > kMovesInMind) {
            tree_.dropped.push_back(moves_.front().folder);
            moves_.erase(moves_.begin());
        }
    }
}

std::optional<FolderId> WatchEvents::TakeMove(uint32_t cookie, std::optional<uint32_t> share) {
    for (auto move = moves_.begin(); move != moves_.end(); ++move) {
        if (move->cookie == cookie && (!share || tree_.table[move->folder].owner == *share)) {
            const FolderId id = move->folder;
            moves_.erase(move);
            return id;
        }
    }
    return std::nullopt;
}

std::optional<std::string> WatchEvents::TakeLeaving(uint32_t cookie, uint32_t share) {
    const auto found = std::find_if(leaving_.begin(), leaving_.end(), [&](const Leaving& leaving) {
        return leaving.cookie == cookie && leaving.share == share;
    });
    if (found == leaving_.end()) {
        return std::nullopt;
    }
    std::string path = std::move(found->path);
    leaving_.erase(found);
    return path;
}

void WatchEvents::NotifyLeaving(const Leaving& leaving) {
    if (const WatchedTree::Share* const share = tree_.FindShare(leaving.share)) {
        tree_.on_change(std::string(share->name), leaving.path);
    }
}

// The kernel tells an exchange as two moves, the second right behind the first. A folder that is
// watched tells itself that it was moved, too.
bool WatchEvents::MayBeOfExchange(const Inotify::Event& event) const {
    const auto is_second_half = [&event](const Leaving& leaving) {
        return leaving.cookie == event.cookie;
    };
    return (event.mask & IN_MOVE_SELF) != 0 ||
           (!arrivals_.empty() && event.cookie == arrivals_.front().cookie + 1 &&
            ((event.mask & IN_MOVED_FROM) != 0 ||
             std::any_of(leaving_.begin(), leaving_.end(), is_second_half)));
}

// Two entries that changed places are told as three moves, by way of a name that neither has: as
// somebody would make them who cannot exchange. So they differ from one that went and came back,
// which has left nothing at the other place.
void WatchEvents::Arrived(const Arrival& arrival) {
    const auto first = std::find_if(arrivals_.begin(), arrivals_.end(), [&](const Arrival& other) {
        return other.share == arrival.share && WithoutSlash(other.from) == arrival.to &&
               WithoutSlash(arrival.from) == other.to;
    });
    const WatchedTree::Share* const share = tree_.FindShare(arrival.share);
    if (first != arrivals_.end() && IsThere(share->folder + first->to)) {
        const Arrival half = *first;
        arrivals_.erase(first);
        const std::string aside = half.to + kAside;
        NotifyMove({0, half.share, half.from, aside});
        NotifyMove(arrival);
        NotifyMove({0, half.share, half.from.back() == '/' ? aside + "/" : aside, half.to});
        return;
    }
    if (!arrivals_.empty() && arrivals_.front().cookie != arrival.cookie) {
        NotifyArrivals();
    }
    arrivals_.push_back(arrival);
}

void WatchEvents::NotifyMove(const Arrival& arrival) {
    if (const WatchedTree::Share* const share = tree_.FindShare(arrival.share)) {
        tree_.NotifyMove(*share, arrival.from, arrival.to);
    }
}

void WatchEvents::NotifyArrivals() {
    for (const Arrival& arrival : std::exchange(arrivals_, {})) {
        NotifyMove(arrival);
    }
}

void WatchEvents::DropMoves() {
    NotifyArrivals();
    for (const Move& move : moves_) {
        tree_.dropped.push_back(move.folder);
    }
    moves_.clear();
    for (const Leaving& leaving : std::exchange(leaving_, {})) {
        NotifyLeaving(leaving);
    }
}

bool WatchEvents::HandleSome() {
    for (int i = 0; i < kEventsPerTurn; ++i) {
        auto event = tree_.inotify.Next();
        if (!event && HasHalfMoves() && tree_.inotify.Await(kSecondEvent)) {
            event = tree_.inotify.Next();
        }
        if (!event) {
            DropMoves();
            tree_.is_ahead = false;
            return false;
        }
        Handle(*event);
    }
    return true;
}

}  // namespace zel_daemon
