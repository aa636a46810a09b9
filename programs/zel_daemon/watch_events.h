// Brings the tree up to date with the kernel's events, and notifies of them.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "programs/zel_daemon/folder_scan.h"
#include "programs/zel_daemon/watched_tree.h"

namespace zel_daemon {

class WatchEvents {
public:
    WatchEvents(WatchedTree& tree, FolderScan& scan) : tree_(tree), scan_(scan) {}

    /// Handles a number of events. True when more may wait.
    bool HandleSome();
    /// Whether something that was moved is not told yet.
    bool HasMoves() const { return HasHalfMoves() || !arrivals_.empty(); }

private:
    struct Move {
        uint32_t cookie;
        FolderId folder;  // without parent until it has its new one
    };

    /// An entry that was moved away, and is notified of with its new place or alone.
    struct Leaving {
        uint32_t cookie;
        uint32_t share;
        std::string path;  // as Watcher::OnMove has it
    };

    /// A move within a share that is not told yet: it may be the first half of an exchange.
    struct Arrival {
        uint32_t cookie;
        uint32_t share;
        std::string from;  // both as Watcher::OnMove has them
        std::string to;
    };

    /// Whether something was moved away whose new place is not known yet.
    bool HasHalfMoves() const { return !moves_.empty() || !leaving_.empty(); }
    void Handle(const Inotify::Event& event);
    void Overflow();
    /// The kernel took the watch away: the folder was deleted, or its file system unmounted, which
    /// shows the folder below.
    void WatchEnded(FolderId id);
    void FolderItself(FolderId id, uint32_t mask);
    void Entry(FolderId parent, const Inotify::Event& event);
    void FolderEntry(FolderId parent, const Inotify::Event& event);
    /// A folder of this share (of any when there is none) whose move has this cookie.
    std::optional<FolderId> TakeMove(uint32_t cookie, std::optional<uint32_t> share);
    /// What has no second event was moved out of all that is watched.
    void DropMoves();
    /// The path in this share from which the entry with this cookie has gone.
    std::optional<std::string> TakeLeaving(uint32_t cookie, uint32_t share);
    void NotifyLeaving(const Leaving& leaving);
    /// Whether the arrivals go on waiting: this event may make them an exchange.
    bool MayBeOfExchange(const Inotify::Event& event) const;
    void Arrived(const Arrival& arrival);
    void NotifyMove(const Arrival& arrival);
    void NotifyArrivals();

    WatchedTree& tree_;
    FolderScan& scan_;
    std::vector<Move> moves_;
    std::vector<Leaving> leaving_;
    std::vector<Arrival> arrivals_;  // of one move, each in another share
};

}  // namespace zel_daemon
