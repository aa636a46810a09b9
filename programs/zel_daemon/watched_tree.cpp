#include "programs/zel_daemon/watched_tree.h"

#include <utility>

namespace zel_daemon {

using base::UniqueFd;

WatchedTree::Share* WatchedTree::FindShare(uint32_t number) {
    const auto found = shares.find(number);
    return found == shares.end() ? nullptr : &found->second;
}

WatchedTree::Share* WatchedTree::Locate(FolderId id) {
    Share* share = FindShare(table[id].owner);
    return share != nullptr && table.Locate(id, &path) == share->root ? share : nullptr;
}

void WatchedTree::Notify(const Share& share, bool with_content) {
    on_change(std::string(share.name), path.empty() || with_content ? path + "/" : path);
}

void WatchedTree::NotifyMove(const Share& share, const std::string& from, const std::string& to) {
    on_move(std::string(share.name), from, to);
}

void WatchedTree::NotifyLoss(const Share& share, const WatchLoss& loss) {
    on_loss(std::string(share.name), loss);
}

FolderId WatchedTree::AddChild(FolderId parent, std::string_view name) {
    const FolderId id = table.Add(table[parent].owner);
    table.Attach(id, parent, name);
    return id;
}

void WatchedTree::Unwatch(FolderId id) {
    const int watch = table[id].watch;
    if (watch < 0) {
        return;
    }
    table.SetWatch(id, -1);
    if (Share* share = FindShare(table[id].owner)) {
        --share->watched;
    }
    if (!table.HasWatch(watch)) {
        inotify.Unwatch(watch);
    }
}

void WatchedTree::SetMissing(FolderId id, bool missing) {
    uint8_t& marks = table[id].marks;
    Share* share = FindShare(table[id].owner);
    if (share != nullptr && missing != ((marks & kMissing) != 0)) {
        share->missing += missing ? size_t{1} : size_t(-1);
    }
    marks = static_cast<uint8_t>(missing ? marks | kMissing : marks & ~kMissing);
}

void WatchedTree::Drop(FolderId id) {
    table.Detach(id);
    dropped.push_back(id);
}

void WatchedTree::DropChildren(FolderId id) {
    while (table[id].FirstChild() != kNoFolder) {
        Drop(table[id].FirstChild());
    }
}

void WatchedTree::RootGone(Share& share) {
    Drop(std::exchange(share.root, kNoFolder));
    share.fd = UniqueFd();
    NotifyLoss(share, {WatchLoss::kFolderGone});
}

}  // namespace zel_daemon
