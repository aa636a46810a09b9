// The table of folders follows the events in their order, while scans see the folders as they
// are now, ahead of the events that still wait. So a name may lead to another folder than the one
// in the table. What keeps the table right all the same:
//
// - A folder is opened by its path, watched by its descriptor, and then known by its watch. When
//   that is not the watch in the table, another folder has taken the place: what is known below is
//   dropped and found anew.
// - A folder is watched before it is read: what appears in between comes as an event.
// - A path that leads nowhere now is dropped: what took it away is an event that still waits. If
//   that is the move of a folder above, all below that one is scanned again once it is in place.
// - A folder that gets its watch later than its share's first scan is notified of then: what was
//   sent before may lack what changed in it unwatched.
#include "programs/zel_daemon/watcher.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <map>
#include <optional>
#include <set>
#include <utility>
#include <vector>

#include "base/open_beneath.h"
#include "programs/zel_daemon/folder_table.h"
#include "programs/zel_daemon/inotify.h"

namespace zel_daemon {

namespace {

using base::UniqueFd;

/// Work goes in turns of some events and some steps of scan: enough events that the kernel's
/// queue does not overflow meanwhile (16,384 unless set otherwise), and enough steps that a flood
/// of events does not keep new folders from being watched.
constexpr int kEventsPerTurn = 256;
constexpr int kStepsPerBusyTurn = 16;
constexpr int kStepsPerIdleTurn = 256;

/// The second event of a move follows the first at once unless another process came in between.
constexpr size_t kMovesInMind = 16;

constexpr size_t kListBufferSize = size_t{32} * 1024;

// What is known of a folder beside its place.
constexpr uint8_t kQueued = 1;    // waits in jobs_
constexpr uint8_t kDeep = 2;      // its next scan goes through all below, known or not
constexpr uint8_t kNotified = 4;  // has an event of its own, or is below such a one
constexpr uint8_t kUnseen = 8;    // its parent is being read and has not shown it yet
constexpr uint8_t kMissing = 16;  // cannot be watched, or not all below it

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

struct Watcher::Impl {
    struct Share {
        std::string name;
        std::string folder;
        FolderId root = kNoFolder;  // kNoFolder: the share's folder is gone
        UniqueFd fd;                // of the root, while scanning: it keeps the volume mounted
        size_t watched = 0;
        size_t missing = 0;
        size_t jobs = 0;  // scans that wait or are under way
        bool first_scan = true;
        std::set<int> notified;  // errors of this scan
    };

    /// A folder whose entries are being read.
    struct Listing {
        FolderId folder;
        uint32_t share;
        UniqueFd fd;
        bool deep;
    };

    struct Move {
        uint32_t cookie;
        FolderId folder;  // without parent until it has its new one
    };

    Impl(OnChange change, OnLoss loss) : on_change(std::move(change)), on_loss(std::move(loss)) {}

    Share* FindShare(uint32_t number) {
        const auto found = shares.find(number);
        return found == shares.end() ? nullptr : &found->second;
    }

    /// The share of a folder, with `path` set to the way from there; nothing when the folder is in
    /// no share any more, or on its way to another place.
    Share* Locate(FolderId id) {
        Share* share = FindShare(table[id].owner);
        return share != nullptr && table.Locate(id, &path) == share->root ? share : nullptr;
    }

    // The callbacks may end the share whose name they are given, so they get a copy; a share that
    // was found before is not used after one.

    /// A change at `path`.
    void Notify(const Share& share) {
        on_change(std::string(share.name), path.empty() ? "/" : path);
    }
    void NotifyLoss(const Share& share, const WatchLoss& loss) {
        on_loss(std::string(share.name), loss);
    }

    // Folders

    FolderId AddChild(FolderId parent, std::string_view name) {
        const FolderId id = table.Add(table[parent].owner);
        table.Attach(id, parent, name);
        return id;
    }

    void Unwatch(FolderId id) {
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

    void SetMissing(FolderId id, bool missing) {
        uint8_t& marks = table[id].marks;
        Share* share = FindShare(table[id].owner);
        if (share != nullptr && missing != ((marks & kMissing) != 0)) {
            share->missing += missing ? size_t{1} : size_t(-1);
        }
        marks = static_cast<uint8_t>(missing ? marks | kMissing : marks & ~kMissing);
    }

    /// Takes the folder and all below it out of the tree; Work() forgets them bit by bit.
    void Drop(FolderId id) {
        table.Detach(id);
        dropped.push_back(id);
    }

    void DropChildren(FolderId id) {
        while (table[id].FirstChild() != kNoFolder) {
            Drop(table[id].FirstChild());
        }
    }

    void ForgetOne() {
        const FolderId id = dropped.back();
        if (table[id].FirstChild() != kNoFolder) {
            Drop(table[id].FirstChild());
            return;
        }
        dropped.pop_back();
        Unwatch(id);
        SetMissing(id, false);
        if (table[id].marks & kQueued) {
            EndJob(table[id].owner);
        }
        if (listing && listing->folder == id) {
            EndListing();
        }
        table.Remove(id);
    }

    void RootGone(Share& share) {
        Drop(std::exchange(share.root, kNoFolder));
        share.fd = UniqueFd();
        NotifyLoss(share, {WatchLoss::kFolderGone});
    }

    // Scanning

    void Enqueue(FolderId id, bool deep) {
        uint8_t& marks = table[id].marks;
        marks = static_cast<uint8_t>(marks | (deep ? kDeep : 0));
        Share* share = FindShare(table[id].owner);
        if ((marks & kQueued) != 0 || share == nullptr) {
            return;
        }
        if (share->jobs++ == 0) {
            share->notified.clear();
        }
        marks |= kQueued;
        jobs.push_back(id);
    }

    void EndJob(uint32_t number) {
        Share* share = FindShare(number);
        if (share != nullptr && --share->jobs == 0) {
            share->fd = UniqueFd();
            share->first_scan = false;
        }
    }

    void EndListing() {
        const uint32_t share = listing->share;
        listing.reset();
        EndJob(share);
    }

    /// The folder that Locate() was asked for last is not watched. One notification in a scan
    /// for each reason.
    void NotifyUnwatched(Share& share, int error) {
        if (share.notified.insert(error).second) {
            NotifyLoss(share, {WatchLoss::kUnwatched, error, path.empty() ? "/" : path});
        }
    }

    /// The same, when nothing below it is watched either. A change of its mode, of which its parent
    /// notifies, brings it back; the root has to notify of its own.
    void Miss(Share& share, FolderId id, int error) {
        if (id != share.root) {
            Unwatch(id);
        }
        DropChildren(id);
        SetMissing(id, true);
        NotifyUnwatched(share, error);
    }

    /// The folder could not be opened or watched, as errno says.
    void Failed(Share& share, FolderId id) {
        if (!IsGone(errno)) {
            Miss(share, id, errno);
        } else if (id == share.root) {
            RootGone(share);
        } else {
            Drop(id);
        }
    }

    /// Opens the share's folder for a scan. It is not held open in between: that would keep its
    /// volume from being unmounted.
    bool OpenRoot(Share& share) {
        if (share.fd) {
            return true;
        }
        share.fd = UniqueFd(open(share.folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!share.fd) {
            return false;
        }
        const int known = table[share.root].watch;
        if (known < 0) {
            return true;
        }
        const int watch = inotify.Watch(share.fd.Get());
        if (watch == known) {
            return true;
        }
        if (watch >= 0) {  // another folder has its name now
            if (!table.HasWatch(watch)) {
                inotify.Unwatch(watch);
            }
            errno = ENOENT;
        }
        share.fd = UniqueFd();
        return false;
    }

    /// Watches the folder that is at `path` now. Nothing with errno when it cannot be.
    UniqueFd WatchFolder(Share& share, FolderId id, bool* is_new) {
        if (path.size() >= PATH_MAX) {  // rsync could not send it either
            errno = ENAMETOOLONG;
            return UniqueFd();
        }
        UniqueFd fd = OpenFolder(share.fd.Get(), path);
        const int watch = fd ? inotify.Watch(fd.Get()) : -1;
        if (watch < 0) {
            return UniqueFd();
        }
        *is_new = watch != table[id].watch;
        if (*is_new) {
            Unwatch(id);
            DropChildren(id);
            table.SetWatch(id, watch);
            ++share.watched;
        }
        SetMissing(id, false);
        return fd;
    }

    void Scan(FolderId id) {
        const uint32_t number = table[id].owner;
        const bool deep = (table[id].marks & kDeep) != 0;
        table[id].marks = static_cast<uint8_t>(table[id].marks & ~(kQueued | kDeep));
        Share* share = Locate(id);
        if (share == nullptr) {
            EndJob(number);
            return;
        }
        bool is_new = false;
        UniqueFd fd;
        if (const int error = inotify.Open()) {
            Miss(*share, id, error);
        } else if (!OpenRoot(*share)) {
            IsGone(errno) ? RootGone(*share) : Miss(*share, id, errno);
        } else if (!(fd = WatchFolder(*share, id, &is_new))) {
            Failed(*share, id);
        }
        if (!fd) {
            EndJob(number);
            return;
        }
        if (is_new || deep) {
            listing = Listing{id, number, std::move(fd), deep && !is_new};
            for (FolderId at = table[id].FirstChild(); at != kNoFolder && listing->deep;
                 at = table[at].NextSibling()) {
                table[at].marks |= kUnseen;
            }
        } else {
            EndJob(number);
        }
        if (is_new && ((table[id].marks & kNotified) != 0 || !share->first_scan)) {
            Notify(*share);
        }
    }

    /// Reads some entries of the folder that is being listed.
    void ListSome() {
        const FolderId id = listing->folder;
        Share* share = Locate(id);
        if (share == nullptr) {
            EndListing();
            return;
        }
        const ssize_t got = getdents64(listing->fd.Get(), list_buffer.get(), kListBufferSize);
        if (got < 0 && !IsGone(errno)) {
            const int error = errno;
            SetMissing(id, true);
            EndListing();
            NotifyUnwatched(*share, error);
            return;
        }
        if (got <= 0) {
            EndDeepListing();
            return;
        }
        const uint8_t notified = share->first_scan ? table[id].marks & kNotified : kNotified;
        for (ssize_t at = 0; at < got;) {
            const auto* entry = reinterpret_cast<const dirent64*>(list_buffer.get() + at);
            at += entry->d_reclen;
            const std::string_view name = entry->d_name;
            if (name != "." && name != ".." && IsFolder(listing->fd.Get(), *entry)) {
                Found(id, name, notified);
            }
        }
    }

    void Found(FolderId parent, std::string_view name, uint8_t notified) {
        FolderId id = table.Child(parent, name);
        const bool is_new = id == kNoFolder;
        if (is_new) {
            id = AddChild(parent, name);
        }
        table[id].marks = static_cast<uint8_t>((table[id].marks & ~kUnseen) | notified);
        if (is_new || listing->deep) {
            Enqueue(id, listing->deep);
        }
    }

    /// Drops what a folder that was read to its end did not show.
    void EndDeepListing() {
        for (FolderId at = table[listing->folder].FirstChild(); at != kNoFolder && listing->deep;) {
            const FolderId next = table[at].NextSibling();
            if (table[at].marks & kUnseen) {
                Drop(at);
            }
            at = next;
        }
        EndListing();
    }

    // Events

    void Handle(const Inotify::Event& event) {
        if (event.mask & IN_Q_OVERFLOW) {
            Overflow();
            return;
        }
        for (const FolderId id : table.WithWatch(event.watch)) {
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
                dropped.push_back(*left);
            }
        }
    }

    void Overflow() {
        DropMoves();
        std::vector<uint32_t> concerned;
        for (const auto& [number, share] : shares) {
            concerned.push_back(number);
        }
        for (const uint32_t number : concerned) {
            Share* share = FindShare(number);
            if (share != nullptr && share->root != kNoFolder) {
                Enqueue(share->root, true);
                share->notified.clear();
                NotifyLoss(*share, {WatchLoss::kOverflow});
            }
        }
    }

    /// The kernel took the watch away: the folder was deleted, or its file system unmounted, which
    /// shows the folder below.
    void WatchEnded(FolderId id) {
        Share* share = Locate(id);
        Unwatch(id);
        if (share != nullptr && id == share->root) {
            RootGone(*share);
        } else if (share != nullptr) {
            table[id].marks |= kNotified;
            Enqueue(id, false);
        }
    }

    void FolderItself(FolderId id, uint32_t mask) {
        Share* share = Locate(id);
        if (share == nullptr) {
            return;
        }
        if (mask & IN_ATTRIB) {
            if (id == share->root && (table[id].marks & kMissing) != 0) {
                Enqueue(id, true);
            }
            Notify(*share);
        } else if (id == share->root &&
                   (mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_UNMOUNT)) != 0) {
            RootGone(*share);
        }  // else the folder's parent notifies
    }

    void Entry(FolderId parent, const Inotify::Event& event) {
        Share* share = Locate(parent);
        if (share == nullptr) {
            return;
        }
        if (event.mask & IN_ISDIR) {
            FolderEntry(parent, event);
        }
        path += '/';
        path += event.name;
        Notify(*share);
    }

    void FolderEntry(FolderId parent, const Inotify::Event& event) {
        FolderId id = table.Child(parent, event.name);
        if (event.mask & IN_MOVED_TO) {
            if (const auto moved = TakeMove(event.cookie, table[parent].owner)) {
                if (id != kNoFolder) {
                    Drop(id);
                }
                table.Attach(*moved, parent, event.name);
                table[*moved].marks =
                    static_cast<uint8_t>((table[*moved].marks & ~kUnseen) | kNotified);
                Enqueue(*moved, true);
                return;
            }
        }
        if (event.mask & (IN_CREATE | IN_MOVED_TO | IN_ATTRIB)) {
            if (id == kNoFolder) {
                id = AddChild(parent, event.name);
            }
            table[id].marks |= kNotified;
            // A change of its mode may have made it readable.
            if ((event.mask & IN_ATTRIB) == 0 || table[id].watch < 0) {
                Enqueue(id, false);
            }
        } else if (id != kNoFolder && (event.mask & IN_DELETE) != 0) {
            Drop(id);
        } else if (id != kNoFolder && (event.mask & IN_MOVED_FROM) != 0) {
            table.Detach(id);
            // When two folders changed places, the other one has this name now.
            Enqueue(AddChild(parent, event.name), false);
            moves.push_back({event.cookie, id});
            if (moves.size() > kMovesInMind) {
                dropped.push_back(moves.front().folder);
                moves.erase(moves.begin());
            }
        }
    }

    /// A folder of this share (of any when there is none) whose move has this cookie.
    std::optional<FolderId> TakeMove(uint32_t cookie, std::optional<uint32_t> share) {
        for (auto move = moves.begin(); move != moves.end(); ++move) {
            if (move->cookie == cookie && (!share || table[move->folder].owner == *share)) {
                const FolderId id = move->folder;
                moves.erase(move);
                return id;
            }
        }
        return std::nullopt;
    }

    /// Folders without a second event were moved out of all that is watched.
    void DropMoves() {
        for (const Move& move : moves) {
            dropped.push_back(move.folder);
        }
        moves.clear();
    }

    // Turns

    bool HasSteps() const { return !dropped.empty() || listing || !jobs.empty(); }

    void Step() {
        if (!dropped.empty()) {
            ForgetOne();
        } else if (listing) {
            ListSome();
        } else {
            const FolderId id = jobs.back();
            jobs.pop_back();
            if (table[id].marks & kQueued) {  // else it was removed since
                Scan(id);
            }
        }
    }

    /// True when more events may wait.
    bool HandleSome() {
        for (int i = 0; i < kEventsPerTurn; ++i) {
            const auto event = inotify.Next();
            if (!event) {
                DropMoves();
                return false;
            }
            Handle(*event);
        }
        return true;
    }

    const OnChange on_change;
    const OnLoss on_loss;
    Inotify inotify;
    FolderTable table;
    std::map<std::string, uint32_t> numbers;  // of shares, by name; never used again
    std::map<uint32_t, Share> shares;
    uint32_t last_number = 0;
    std::vector<FolderId> jobs;  // to be scanned, the last first
    std::vector<FolderId>
        dropped;  // without parent; to be forgotten with all below, the last first
    std::optional<Listing> listing;
    std::vector<Move> moves;
    std::string path;  // of the folder that Locate() was asked for last
    std::unique_ptr<char[]> list_buffer{new char[kListBufferSize]};
};

Watcher::Watcher(OnChange on_change, OnLoss on_loss)
    : impl_(std::make_unique<Impl>(std::move(on_change), std::move(on_loss))) {}

Watcher::~Watcher() = default;

bool Watcher::Open() {
    return impl_->inotify.Open() == 0;
}

int Watcher::Fd() const {
    return impl_->inotify.Fd();
}

void Watcher::Add(const std::string& share, const std::string& folder) {
    Remove(share);
    const uint32_t number = ++impl_->last_number;
    impl_->numbers[share] = number;
    Impl::Share& added = impl_->shares[number];
    added.name = share;
    added.folder = folder;
    added.root = impl_->table.Add(number);
    impl_->Enqueue(added.root, false);
}

void Watcher::Remove(const std::string& share) {
    const auto number = impl_->numbers.find(share);
    if (number == impl_->numbers.end()) {
        return;
    }
    const auto found = impl_->shares.find(number->second);
    if (found->second.root != kNoFolder) {
        impl_->Drop(found->second.root);
    }
    impl_->shares.erase(found);
    impl_->numbers.erase(number);
}

void Watcher::Rescan(const std::string& share) {
    const auto number = impl_->numbers.find(share);
    if (number == impl_->numbers.end()) {
        return;
    }
    Impl::Share& found = impl_->shares.at(number->second);
    if (found.root != kNoFolder) {
        impl_->Enqueue(found.root, true);
        found.notified.clear();
    }
}

bool Watcher::Work(std::chrono::milliseconds budget) {
    const auto end = std::chrono::steady_clock::now() + budget;
    bool more_events = true;
    bool in_time = true;
    while (in_time && (more_events || impl_->HasSteps())) {
        more_events = impl_->HandleSome();
        const int steps = more_events ? kStepsPerBusyTurn : kStepsPerIdleTurn;
        for (int i = 0; in_time && i < steps && impl_->HasSteps(); ++i) {
            impl_->Step();
            in_time = std::chrono::steady_clock::now() < end;
        }
        in_time = in_time && std::chrono::steady_clock::now() < end;
    }
    return impl_->HasSteps() || !impl_->moves.empty() || impl_->inotify.Buffered();
}

WatchStats Watcher::Stats(const std::string& share) const {
    const auto number = impl_->numbers.find(share);
    if (number == impl_->numbers.end()) {
        return WatchStats();
    }
    const Impl::Share& found = impl_->shares.at(number->second);
    WatchStats stats;
    stats.complete = found.root != kNoFolder && found.missing == 0;
    if (found.root != kNoFolder) {
        stats.folders = found.watched;
        stats.scanning = found.jobs != 0;
    }
    return stats;
}

WatchStats Watcher::Stats() const {
    WatchStats all;
    all.complete = true;
    for (const auto& [share, number] : impl_->numbers) {
        const WatchStats one = Stats(share);
        all.folders += one.folders;
        all.scanning = all.scanning || one.scanning;
        all.complete = all.complete && one.complete;
    }
    return all;
}

}  // namespace zel_daemon
