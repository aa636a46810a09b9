#include "programs/zel_daemon/folder_scan.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>

#include <cerrno>
#include <string>
#include <utility>

#include "base/open_beneath.h"

namespace zel_daemon {

namespace {

using base::UniqueFd;

constexpr size_t kListBufferSize = size_t{32} * 1024;

/// EXDEV: moved out of the share just while it was looked up.
bool IsGone(int error) {
    return error == ENOENT || error == ENOTDIR || error == ELOOP || error == EXDEV;
}

/// Opens the folder at `path` below `root`, which no symbolic link on the way leads to.
UniqueFd OpenFolder(int root, const std::string& path) {
    return base::OpenBeneath(root, path.empty() ? path : path.substr(1),
                             O_RDONLY | O_DIRECTORY | O_NONBLOCK);
}

bool IsFolder(int parent, const dirent64& entry) {
    if (entry.d_type != DT_UNKNOWN) {
        return entry.d_type == DT_DIR;
    }
    struct stat status;
    return fstatat(parent, entry.d_name, &status, AT_SYMLINK_NOFOLLOW) == 0 &&
           S_ISDIR(status.st_mode);
}

}  // namespace

FolderScan::FolderScan(WatchedTree& tree) : tree_(tree), list_buffer_(new char[kListBufferSize]) {}

void FolderScan::Enqueue(FolderId id, bool deep) {
    uint8_t& marks = tree_.table[id].marks;
    marks = static_cast<uint8_t>(marks | (deep ? kDeep : 0));
    WatchedTree::Share* share = tree_.FindShare(tree_.table[id].owner);
    if ((marks & kQueued) != 0 || share == nullptr) {
        return;
    }
    if (share->jobs++ == 0) {
        share->notified.clear();
    }
    marks |= kQueued;
    jobs_.push_back(id);
}

void FolderScan::EndJob(uint32_t number) {
    WatchedTree::Share* share = tree_.FindShare(number);
    if (share != nullptr && --share->jobs == 0) {
        share->fd = UniqueFd();
        share->first_scan = false;
    }
}

void FolderScan::EndListing() {
    const uint32_t share = listing_->share;
    listing_.reset();
    EndJob(share);
}

void FolderScan::NotifyUnwatched(WatchedTree::Share& share, int error) {
    if (share.notified.insert(error).second) {
        tree_.NotifyLoss(share,
                         {WatchLoss::kUnwatched, error, tree_.path.empty() ? "/" : tree_.path});
    }
}

void FolderScan::Miss(WatchedTree::Share& share, FolderId id, int error) {
    if (id != share.root) {
        tree_.Unwatch(id);
    }
    tree_.DropChildren(id);
    tree_.SetMissing(id, true);
    NotifyUnwatched(share, error);
}

void FolderScan::Failed(WatchedTree::Share& share, FolderId id) {
    if (!IsGone(errno)) {
        Miss(share, id, errno);
    } else if (id == share.root) {
        tree_.RootGone(share);
    } else {
        tree_.Drop(id);
    }
}

bool FolderScan::OpenRoot(WatchedTree::Share& share) {
    if (share.fd) {
        return true;
    }
    share.fd = UniqueFd(open(share.folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!share.fd) {
        return false;
    }
    const int known = tree_.table[share.root].watch;
    if (known < 0) {
        return true;
    }
    const int watch = tree_.inotify.Watch(share.fd.Get());
    if (watch == known) {
        return true;
    }
    if (watch >= 0) {  // another folder has its name now
        if (!tree_.table.HasWatch(watch)) {
            tree_.inotify.Unwatch(watch);
        }
        errno = ENOENT;
    }
    share.fd = UniqueFd();
    return false;
}

base::UniqueFd FolderScan::WatchFolder(WatchedTree::Share& share, FolderId id, bool* is_new) {
    if (tree_.path.size() >= PATH_MAX) {  // rsync could not send it either
        errno = ENAMETOOLONG;
        return UniqueFd();
    }
    UniqueFd fd = OpenFolder(share.fd.Get(), tree_.path);
    const int watch = fd ? tree_.inotify.Watch(fd.Get()) : -1;
    if (watch < 0) {
        return UniqueFd();
    }
    *is_new = watch != tree_.table[id].watch;
    if (*is_new) {
        tree_.Unwatch(id);
        tree_.DropChildren(id);
        tree_.table.SetWatch(id, watch);
        ++share.watched;
    }
    tree_.SetMissing(id, false);
    return fd;
}

void FolderScan::Scan(FolderId id) {
    const uint32_t number = tree_.table[id].owner;
    const bool deep = (tree_.table[id].marks & kDeep) != 0;
    tree_.table[id].marks = static_cast<uint8_t>(tree_.table[id].marks & ~(kQueued | kDeep));
    WatchedTree::Share* share = tree_.Locate(id);
    if (share == nullptr) {
        EndJob(number);
        return;
    }
    tree_.is_ahead = true;
    bool is_new = false;
    UniqueFd fd;
    if (const int error = tree_.inotify.Open()) {
        Miss(*share, id, error);
    } else if (!OpenRoot(*share)) {
        IsGone(errno) ? tree_.RootGone(*share) : Miss(*share, id, errno);
    } else if (!(fd = WatchFolder(*share, id, &is_new))) {
        Failed(*share, id);
    }
    if (!fd) {
        EndJob(number);
        return;
    }
    if (is_new || deep) {
        listing_ = Listing{id, number, std::move(fd), deep && !is_new};
        for (FolderId at = tree_.table[id].FirstChild(); at != kNoFolder && listing_->deep;
             at = tree_.table[at].NextSibling()) {
            tree_.table[at].marks |= kUnseen;
        }
    } else {
        EndJob(number);
    }
    if (is_new && ((tree_.table[id].marks & kNotified) != 0 || !share->first_scan)) {
        tree_.Notify(*share);
    }
}

void FolderScan::ListSome() {
    const FolderId id = listing_->folder;
    WatchedTree::Share* share = tree_.Locate(id);
    if (share == nullptr) {
        EndListing();
        return;
    }
    tree_.is_ahead = true;
    const ssize_t got = getdents64(listing_->fd.Get(), list_buffer_.get(), kListBufferSize);
    if (got < 0 && !IsGone(errno)) {
        const int error = errno;
        tree_.SetMissing(id, true);
        EndListing();
        NotifyUnwatched(*share, error);
        return;
    }
    if (got <= 0) {
        EndDeepListing();
        return;
    }
    const uint8_t notified = share->first_scan ? tree_.table[id].marks & kNotified : kNotified;
    for (ssize_t at = 0; at < got;) {
        const auto* entry = reinterpret_cast<const dirent64*>(list_buffer_.get() + at);
        at += entry->d_reclen;
        const std::string_view name = entry->d_name;
        if (name != "." && name != ".." && IsFolder(listing_->fd.Get(), *entry)) {
            Found(id, name, notified);
        }
    }
}

void FolderScan::Found(FolderId parent, std::string_view name, uint8_t notified) {
    FolderId id = tree_.table.Child(parent, name);
    const bool is_new = id == kNoFolder;
    if (is_new) {
        id = tree_.AddChild(parent, name);
    }
    tree_.table[id].marks = static_cast<uint8_t>((tree_.table[id].marks & ~kUnseen) | notified);
    if (is_new || listing_->deep) {
        Enqueue(id, listing_->deep);
    }
}

void FolderScan::EndDeepListing() {
    for (FolderId at = tree_.table[listing_->folder].FirstChild();
         at != kNoFolder && listing_->deep;) {
        const FolderId next = tree_.table[at].NextSibling();
        if (tree_.table[at].marks & kUnseen) {
            tree_.Drop(at);
        }
        at = next;
    }
    EndListing();
}

void FolderScan::ForgetOne() {
    const FolderId id = tree_.dropped.back();
    if (tree_.table[id].FirstChild() != kNoFolder) {
        tree_.Drop(tree_.table[id].FirstChild());
        return;
    }
    tree_.dropped.pop_back();
    tree_.Unwatch(id);
    tree_.SetMissing(id, false);
    if (tree_.table[id].marks & kQueued) {
        EndJob(tree_.table[id].owner);
    }
    if (listing_ && listing_->folder == id) {
        EndListing();
    }
    tree_.table.Remove(id);
}

bool FolderScan::HasSteps() const {
    return !tree_.dropped.empty() || listing_ || !jobs_.empty();
}

void FolderScan::Step() {
    if (!tree_.dropped.empty()) {
        ForgetOne();
    } else if (listing_) {
        ListSome();
    } else {
        const FolderId id = jobs_.back();
        jobs_.pop_back();
        if (tree_.table[id].marks & kQueued) {  // else it was removed since
            Scan(id);
        }
    }
}

}  // namespace zel_daemon
