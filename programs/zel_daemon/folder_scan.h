// Finds the folders below shares and gives each its watch, in small steps.
#pragma once

#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "base/unique_fd.h"
#include "programs/zel_daemon/watched_tree.h"

namespace zel_daemon {

class FolderScan {
public:
    explicit FolderScan(WatchedTree& tree);

    /// Has the folder scanned; `deep`: with all below it, known or not.
    void Enqueue(FolderId id, bool deep);
    bool HasSteps() const;
    /// One step: forgets a dropped folder, reads some entries, or begins the next folder.
    void Step();

private:
    /// A folder whose entries are being read.
    struct Listing {
        FolderId folder;
        uint32_t share;
        base::UniqueFd fd;
        bool deep;
    };

    void EndJob(uint32_t number);
    void EndListing();
    /// The folder that Locate() was asked for last is not watched. One notification in a scan
    /// for each reason.
    void NotifyUnwatched(WatchedTree::Share& share, int error);
    /// The same, when nothing below it is watched either. A change of its mode, of which its parent
    /// notifies, brings it back; the root has to notify of its own.
    void Miss(WatchedTree::Share& share, FolderId id, int error);
    /// The folder could not be opened or watched, as errno says.
    void Failed(WatchedTree::Share& share, FolderId id);
    /// Opens the share's folder for a scan. It is not held open in between: that would keep its
    /// volume from being unmounted.
    bool OpenRoot(WatchedTree::Share& share);
    /// Watches the folder that is at `path` now. Nothing with errno when it cannot be.
    base::UniqueFd WatchFolder(WatchedTree::Share& share, FolderId id, bool* is_new);
    void Scan(FolderId id);
    /// Reads some entries of the folder that is being listed.
    void ListSome();
    void Found(FolderId parent, std::string_view name, uint8_t notified);
    /// Drops what a folder that was read to its end did not show.
    void EndDeepListing();
    void ForgetOne();

    WatchedTree& tree_;
    std::vector<FolderId> jobs_;  // to be scanned, the last first
    std::optional<Listing> listing_;
    std::unique_ptr<char[]> list_buffer_;
};

}  // namespace zel_daemon
