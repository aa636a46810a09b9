// What a watcher knows: shares and their folders, each with its watch.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "base/unique_fd.h"
#include "programs/zel_daemon/folder_table.h"
#include "programs/zel_daemon/inotify.h"
#include "programs/zel_daemon/watcher.h"

namespace zel_daemon {

// Marks of a folder in the table.
constexpr uint8_t kQueued = 1;    // waits to be scanned
constexpr uint8_t kDeep = 2;      // its next scan goes through all below, known or not
constexpr uint8_t kNotified = 4;  // has an event of its own, or is below such a one
constexpr uint8_t kUnseen = 8;    // its parent is being read and has not shown it yet
constexpr uint8_t kMissing = 16;  // cannot be watched, or not all below it

/// The shares and their folders.
///
/// The table of folders follows the events in their order, while scans see the folders as they are
/// now, ahead of the events that still wait. So a name may lead to another folder than the one in
/// the table. These rules keep the table right:
///
/// - A folder is opened by its path, watched by its descriptor, and then known by its watch. When
///   that is not the watch in the table, another folder has taken the place: what is known below is
///   dropped and found anew.
/// - A folder is watched before it is read: what appears in between comes as an event.
/// - A path that leads nowhere now is dropped: what took it away is an event that still waits. If
///   that is the move of a folder above, all below that one is scanned again once it is in place.
///   Where no scan can have come before the event, the folders move with what is known of them.
/// - A folder that gets its watch later than its share's first scan is notified of then: what was
///   sent before may lack what changed in it unwatched.
struct WatchedTree {
    struct Share {
        std::string name;
        std::string folder;
        FolderId root = kNoFolder;  ///< kNoFolder: the share's folder is gone
        base::UniqueFd fd;          ///< of the root, while scanning: it keeps the volume mounted
        size_t watched = 0;
        size_t missing = 0;
        size_t jobs = 0;  ///< scans that wait or are under way
        bool first_scan = true;
        std::set<int> notified;  ///< errors of this scan
    };

    Share* FindShare(uint32_t number);
    /// The share of a folder, with `path` set to the way from there; nothing when the folder is in
    /// no share any more, or on its way to another place.
    Share* Locate(FolderId id);
    /// Report a change at `path`, a folder `with_content` or a single entry, or a loss. The
    /// callbacks may remove the share: a share that was found before is not used after them.
    void Notify(const Share& share, bool with_content = false);
    void NotifyMove(const Share& share, const std::string& from, const std::string& to);
    void NotifyLoss(const Share& share, const WatchLoss& loss);

    FolderId AddChild(FolderId parent, std::string_view name);
    /// Ends the folder's watch, if it has one.
    void Unwatch(FolderId id);
    /// Whether the folder, or a part of what is below it, cannot be watched.
    void SetMissing(FolderId id, bool missing);
    /// Takes the folder and all below it out of the tree; they are forgotten bit by bit.
    void Drop(FolderId id);
    void DropChildren(FolderId id);
    /// The share's folder is gone.
    void RootGone(Share& share);

    const Watcher::OnChange on_change;
    const Watcher::OnMove on_move;
    const Watcher::OnLoss on_loss;
    Inotify inotify;
    FolderTable table;
    std::map<uint32_t, Share> shares;  // by a number that is never used again
    std::vector<FolderId> dropped;     // roots of trees to be forgotten, the last first
    std::string path;                  // of the folder that Locate() was asked for last
    bool is_ahead = false;             // scans have seen what events that still wait may tell
};

}  // namespace zel_daemon
