// Loaded into each rsync daemon that serves clients (LD_PRELOAD). Whatever a client makes that
// rsync do, what a run has put among its versions stays there as it was.
//
// rsync itself does not promise that:
// - It replaces a version when a client sends the same file twice in a run, and removes one when
//   another run has made a folder of the file meanwhile. So of what lies in COPY/.zel_versions
//   nothing is removed, replaced or moved away here.
// - It writes into what it takes for the part of a broken upload, in the folder of that name; which
//   may be a link that leads to files of the share, or hold a file that has other names. So a file
//   is written anew, or in a folder of such parts, or not at all.
// Such a call fails with EPERM, with which rsync leaves the file in the share alone. Links and new
// files are added as ever.
//
// And what a run has of a large file when it ends in the midst of it stays in COPY/.zel_partial.
//
// It asks the kernel alone, by open folders: paths are the client's choice, in a chroot there is no
// /proc, and rsync's versions differ in whether they use paths or descriptors.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "base/unique_fd.h"
#include "programs/zel_server/versions_guard.h"
#include "tarq/rsync_wrapper.h"

#define EXPORTED extern "C" __attribute__((visibility("default")))

namespace {

using base::UniqueFd;
using TARQ::Backup::kPartialsFolder;
using TARQ::Backup::kResumedFolder;
using TARQ::Backup::kVersionsFolder;

constexpr int kMaxDepth = PATH_MAX;
constexpr size_t kRemembered = 4096;
// Less is sent again as fast as it is found.
constexpr off_t kWorthKeeping = off_t{1} << 20;

// What no other folder ever is, also after this one is gone; empty where the file system does not
// say when a file was made.
struct Identity {
    uint64_t device = 0;
    uint64_t inode = 0;
    int64_t born_seconds = 0;
    uint32_t born_nanoseconds = 0;
    bool has_birth = false;

    bool IsSameFile(const Identity& other) const {
        return device == other.device && inode == other.inode;
    }
    bool operator==(const Identity& other) const {
        return IsSameFile(other) && has_birth && other.has_birth &&
               born_seconds == other.born_seconds && born_nanoseconds == other.born_nanoseconds;
    }
};

bool Identify(int folder, const char* name, Identity& identity) {
    struct statx facts = {};
    if (statx(folder, name, AT_SYMLINK_NOFOLLOW | AT_EMPTY_PATH, STATX_INO | STATX_BTIME, &facts) !=
        0) {
        return false;
    }
    identity.device = makedev(facts.stx_dev_major, facts.stx_dev_minor);
    identity.inode = facts.stx_ino;
    identity.has_birth = (facts.stx_mask & STATX_BTIME) != 0;
    identity.born_seconds = facts.stx_btime.tv_sec;
    identity.born_nanoseconds = facts.stx_btime.tv_nsec;
    return true;
}

UniqueFd OpenFolder(int above, const char* path) {
    return UniqueFd(openat(above, path, O_PATH | O_DIRECTORY | O_CLOEXEC));
}

// A folder of the service at the root of the copy, as this process may name it: the module's, in a
// chroot or without one. And that root itself.
class Reserved {
public:
    explicit Reserved(const char* name) : name_(name) {
        Add("");
        const char* const module = getenv("RSYNC_MODULE_PATH");
        Add(module != nullptr ? module : "");
    }
    bool None() const { return count_ == 0; }
    bool Is(const Identity& folder) const { return Holds(folders_, folder); }
    bool IsRoot(const Identity& folder) const { return Holds(roots_, folder); }

private:
    bool Holds(const Identity* known, const Identity& folder) const {
        for (size_t i = 0; i < count_; ++i) {
            if (known[i].IsSameFile(folder)) {
                return true;
            }
        }
        return false;
    }
    void Add(const char* root) {
        char path[PATH_MAX];
        const int length = snprintf(path, sizeof path, "%s/%s", root, name_);
        if (length > 0 && static_cast<size_t>(length) < sizeof path &&
            Identify(AT_FDCWD, path, folders_[count_]) &&
            Identify(AT_FDCWD, *root == '\0' ? "/" : root, roots_[count_])) {
            ++count_;
        }
    }

    const char* name_;
    Identity folders_[2];
    Identity roots_[2];
    size_t count_ = 0;
};

// Folders that are not among the versions, and never will be: rsync moves no folders.
Identity outside[kRemembered];

// Whether `is_it` holds for the folder or one above it; `unknown` when nobody can say.
template <typename Predicate>
bool IsBelow(int folder, Predicate is_it, bool unknown) {
    UniqueFd at = OpenFolder(folder, ".");
    Identity identity;
    if (!at || !Identify(at.Get(), "", identity)) {
        return unknown;
    }
    for (int depth = 0; depth < kMaxDepth; ++depth) {
        if (is_it(identity)) {
            return true;
        }
        UniqueFd above = OpenFolder(at.Get(), "..");
        Identity next;
        if (!above || !Identify(above.Get(), "", next)) {
            return unknown;
        }
        if (next.IsSameFile(identity)) {
            return false;  // the root folder
        }
        at = std::move(above);
        identity = next;
    }
    return unknown;
}

// Folders that were made one after the other have numbers with a pattern.
size_t PlaceOf(const Identity& folder) {
    constexpr uint64_t kSpread = 0x9E3779B97F4A7C15;
    return static_cast<size_t>((folder.inode * kSpread) >> 32) % kRemembered;
}

bool IsAmongVersions(int folder) {
    Identity identity;
    if (!Identify(folder, "", identity)) {
        return true;
    }
    Identity& remembered = outside[PlaceOf(identity)];
    if (remembered == identity) {
        return false;
    }
    const Reserved versions(kVersionsFolder);
    if (versions.None()) {
        return false;
    }
    if (IsBelow(
            folder, [&](const Identity& above) { return versions.Is(above); }, true)) {
        return true;
    }
    remembered = identity;
    return false;
}

// A folder that is held open, and whether it lies among the versions: so it will be for ever.
struct HeldFolder {
    char path[PATH_MAX] = "";
    UniqueFd folder;
    bool is_kept = false;
};

// Of either end of what is moved those of the last path in a folder of the service and of the last
// other one: rsync goes through a folder file by file, and comes back to the one in which it writes
// them. One that has another name by now is still the folder that was looked at; one that has gone
// is empty.
HeldFolder held[2][2];

void HoldNone() {
    for (HeldFolder(&of_end)[2] : held) {
        of_end[0].folder.Reset();
        of_end[1].folder.Reset();
    }
}

// The entry at a path, by its folder, which is held open: what is found out about that holds for
// the call that is made with it.
class Place {
public:
    enum End { kFrom, kTo };  // the folder is held until the next one of that end is

    Place(int above, const char* path, End end = kFrom) : name_(LastName(path)) {
        Open(above, path, end);
    }
    explicit operator bool() const { return above_ >= 0; }

    int Above() const { return above_; }
    const char* Name() const { return name_; }

    bool Exists() const {
        struct stat info = {};
        return fstatat(Above(), name_, &info, AT_SYMLINK_NOFOLLOW) == 0;
    }
    /// Whether it lies among the versions, or is the folder of all of them.
    bool IsKept() const {
        Identity identity;
        return is_kept_ ||
               (strncmp(name_, kVersionsFolder, strlen(kVersionsFolder)) == 0 &&
                Identify(Above(), name_, identity) && Reserved(kVersionsFolder).Is(identity));
    }

private:
    static bool IsOfTheService(const char* path) {
        const char* const name = *path == '/' ? path + 1 : path;
        return strncmp(name, kVersionsFolder, strlen(kVersionsFolder)) == 0 ||
               strncmp(name, kPartialsFolder, strlen(kPartialsFolder)) == 0;
    }
    // With the slashes that end the path, which mean something to the kernel.
    static const char* LastName(const char* path) {
        const char* name = path + strlen(path);
        while (name > path && name[-1] == '/') {
            --name;
        }
        while (name > path && name[-1] != '/') {
            --name;
        }
        return name;
    }
    void Open(int above, const char* path, End end) {
        char folder[PATH_MAX] = ".";
        const size_t length = static_cast<size_t>(name_ - path);
        if (length >= sizeof folder || *name_ == '\0') {
            errno = *name_ == '\0' ? ENOENT : ENAMETOOLONG;
            return;
        }
        if (length > 0) {
            memcpy(folder, path, length);
            folder[length] = '\0';
        }
        if (above != AT_FDCWD) {
            own_ = OpenFolder(above, folder);
            above_ = own_.Get();
            is_kept_ = own_ && IsAmongVersions(above_);
            return;
        }
        HeldFolder& last = held[end][IsOfTheService(path) ? 1 : 0];
        if (!last.folder || strcmp(last.path, folder) != 0) {
            last.folder = OpenFolder(above, folder);
            memcpy(last.path, folder, strlen(folder) + 1);
            last.is_kept = last.folder && IsAmongVersions(last.folder.Get());
        }
        above_ = last.folder.Get();
        is_kept_ = last.is_kept;
    }

    const char* name_;
    int above_ = -1;
    bool is_kept_ = false;
    UniqueFd own_;
};

int Refuse() {
    errno = EPERM;
    return -1;
}

int Rename(const Place& from, const Place& to, unsigned int flags) {
    return static_cast<int>(
        syscall(SYS_renameat2, from.Above(), from.Name(), to.Above(), to.Name(), flags));
}

// Whether a run writes its files in the folder.
bool IsOfARun(int folder) {
    const Reserved parts(kPartialsFolder);
    return IsBelow(
        folder, [&](const Identity& above) { return parts.Is(above); }, false);
}

// Whether the folder holds parts of broken uploads: by what it is, not by a link's name.
bool HoldsParts(int folder) {
    Identity identity;
    Identity named;
    const UniqueFd above = OpenFolder(folder, "..");
    return above && Identify(folder, "", identity) &&
           ((Identify(above.Get(), kResumedFolder, named) && named.IsSameFile(identity)) ||
            IsOfARun(folder));
}

// Whether a run removes what it has of a large file because it ends before that is whole. It stays,
// for the next run to go on with; what nobody wants the server removes.
bool IsWorthKeeping(const Place& place) {
    struct stat info = {};
    return fstatat(place.Above(), place.Name(), &info, AT_SYMLINK_NOFOLLOW) == 0 &&
           S_ISREG(info.st_mode) && info.st_nlink == 1 && info.st_size >= kWorthKeeping &&
           IsOfARun(place.Above());
}

int Open(int above, const char* path, int flags, mode_t mode) {
    const auto open_at = [mode](int folder, const char* name, int how) {
        return static_cast<int>(syscall(SYS_openat, folder, name, how, mode));
    };
    const bool is_new = (flags & (O_CREAT | O_EXCL)) == (O_CREAT | O_EXCL);
    if ((flags & O_ACCMODE) == O_RDONLY || is_new) {
        return open_at(above, path, flags);
    }
    const Reserved versions(kVersionsFolder);
    if (versions.None()) {  // no run that writes
        return open_at(above, path, flags);
    }
    const Place place(above, path);
    if (!place) {
        return -1;
    }
    if (!IsBelow(
            place.Above(), [&](const Identity& folder) { return versions.IsRoot(folder); }, true)) {
        return open_at(place.Above(), place.Name(), flags);
    }
    struct stat info = {};
    if (fstatat(place.Above(), place.Name(), &info, AT_SYMLINK_NOFOLLOW) != 0) {
        return open_at(place.Above(), place.Name(), flags | ((flags & O_CREAT) != 0 ? O_EXCL : 0));
    }
    if (S_ISREG(info.st_mode) && (info.st_nlink != 1 || !HoldsParts(place.Above()))) {
        return Refuse();
    }
    return open_at(place.Above(), place.Name(), flags | O_NOFOLLOW);
}

// rsync has no use for it after the start, and what it runs is not to have this library.
__attribute__((constructor)) void Begin() {
    unsetenv("LD_PRELOAD");
    setenv(zel_server::kGuardVariable, "1", 1);
}

}  // namespace

EXPORTED int renameat2(int from_folder, const char* from_path, int to_folder, const char* to_path,
                       unsigned int flags) noexcept {
    const Place from(from_folder, from_path);
    if (!from) {
        return -1;
    }
    if (from.IsKept()) {
        return from.Exists() ? Refuse() : -1;
    }
    const Place to(to_folder, to_path, Place::kTo);
    if (!to) {
        return -1;
    }
    if (!to.IsKept()) {
        return Rename(from, to, flags);
    }
    // What comes to the versions comes so.
    const int status = flags == 0 ? Rename(from, to, RENAME_NOREPLACE) : Refuse();
    const bool is_refused = status != 0 && (errno == EEXIST || errno == EPERM);
    if (status == 0 || (!is_refused && errno != EINVAL && errno != ENOSYS)) {
        return status;
    }
    return is_refused || to.Exists() ? Refuse() : Rename(from, to, 0);
}

EXPORTED int renameat(int from_folder, const char* from_path, int to_folder,
                      const char* to_path) noexcept {
    return renameat2(from_folder, from_path, to_folder, to_path, 0);
}

EXPORTED int rename(const char* from_path, const char* to_path) noexcept {
    return renameat2(AT_FDCWD, from_path, AT_FDCWD, to_path, 0);
}

EXPORTED int unlinkat(int folder, const char* path, int flags) noexcept {
    const Place place(folder, path);
    if (!place) {
        return -1;
    }
    if (place.IsKept()) {
        return place.Exists() ? Refuse() : -1;
    }
    if (flags == 0 && IsWorthKeeping(place)) {
        return 0;
    }
    return static_cast<int>(syscall(SYS_unlinkat, place.Above(), place.Name(), flags));
}

EXPORTED int unlink(const char* path) noexcept {
    return unlinkat(AT_FDCWD, path, 0);
}

EXPORTED int rmdir(const char* path) noexcept {
    return unlinkat(AT_FDCWD, path, AT_REMOVEDIR);
}

// A path leads elsewhere then.
EXPORTED int chdir(const char* path) noexcept {
    HoldNone();
    return static_cast<int>(syscall(SYS_chdir, path));
}

EXPORTED int fchdir(int folder) noexcept {
    HoldNone();
    return static_cast<int>(syscall(SYS_fchdir, folder));
}

EXPORTED int chroot(const char* path) noexcept {
    HoldNone();
    return static_cast<int>(syscall(SYS_chroot, path));
}

// The C library has names of its own for files of more than 2 GiB, and for calls whose flags the
// compiler knows.
#define OPENED(name, large)                                                                        \
    EXPORTED int Guarded_##name(const char* path, int flags, mode_t mode) noexcept __asm__(#name); \
    EXPORTED int Guarded_##name(const char* path, int flags, mode_t mode) noexcept {               \
        return Open(AT_FDCWD, path, flags | (large), mode);                                        \
    }
#define OPENED_AT(name, large)                                                                  \
    EXPORTED int Guarded_##name(int above, const char* path, int flags,                         \
                                mode_t mode) noexcept __asm__(#name);                           \
    EXPORTED int Guarded_##name(int above, const char* path, int flags, mode_t mode) noexcept { \
        return Open(above, path, flags | (large), mode);                                        \
    }
OPENED(open, 0)
OPENED(open64, O_LARGEFILE)
OPENED(__open_2, 0)
OPENED(__open64_2, O_LARGEFILE)
OPENED_AT(openat, 0)
OPENED_AT(openat64, O_LARGEFILE)
OPENED_AT(__openat_2, 0)
OPENED_AT(__openat64_2, O_LARGEFILE)
