#include "programs/zel_server/past_tree.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <map>
#include <set>
#include <system_error>
#include <vector>

#include "base/folder_names.h"
#include "base/open_beneath.h"
#include "programs/common/share_path.h"
#include "programs/zel_server/copy_moves.h"
#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/storage.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;
using base::OpenBeneath;
using base::UniqueFd;

constexpr char kTreesInStorage[] = ".restores";
constexpr int kFolderFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

struct NoBirthTime {};

[[noreturn]] void Fail(const std::string& what) {
    throw std::system_error(errno, std::generic_category(), what);
}

// Whether errno says that nothing of the kind that was looked for is at a path (any more), or that
// the path is one that rsync could not send either.
bool IsGone() {
    return errno == ENOENT || errno == ENOTDIR || errno == ELOOP || errno == ENAMETOOLONG;
}

// The entry `name` of the open folder, or the folder itself when that is empty.
struct Entry {
    bool is_there = false;
    bool is_folder = false;
    VersionTime born;

    Entry(int folder, const char* name) {
        struct statx facts = {};
        const int flags = AT_SYMLINK_NOFOLLOW | (*name == '\0' ? AT_EMPTY_PATH : 0);
        if (statx(folder, name, flags, STATX_TYPE | STATX_BTIME, &facts) != 0) {
            if (!IsGone()) {
                Fail("cannot look at a file of a copy");
            }
            return;
        }
        if ((facts.stx_mask & STATX_BTIME) == 0) {
            throw NoBirthTime();
        }
        is_there = true;
        is_folder = S_ISDIR(facts.stx_mode);
        born = {facts.stx_btime.tv_sec, static_cast<int32_t>(facts.stx_btime.tv_nsec)};
    }
    bool StoodAt(const VersionTime& at) const { return is_there && !(at < born); }
};

std::vector<std::string> NamesIn(const UniqueFd& folder) {
    auto names = base::NamesIn(folder.Get());
    if (!names) {
        Fail("cannot list a folder of a copy");
    }
    return *std::move(names);
}

/// The tree that is being made. First it takes the versions: of what stood at a path until then,
/// the one that ended first stays, as the file that took its place may have been made before, in an
/// upload that took its time. Then what the copy has; and then the versions that have come
/// meanwhile, among which is what a push has replaced or deleted before it could be taken.
class Assembly {
public:
    /// `copy`: the share's folder; not open when that is gone. `present`: its names, since the time
    /// of the order.
    Assembly(int tree, int copy, const MovedNames& present, const PastTreeOrder& order)
        : tree_(tree), copy_(copy), present_(present), path_(order.path), at_(order.at) {}

    /// Takes what is below the folder `source`, the copy or a folder of versions, belongs to the
    /// path that is wanted and stood there at the time. `names`: how what stood there was called in
    /// `source`.
    void Take(int source, const MovedNames& names) {
        for (const std::string& place : names.PlacesOf(path_)) {
            TakePlace({source, names}, place);
        }
    }

    /// Gives the folders their modes and times. Returns whether there is anything in the tree.
    bool Finish() {
        for (const auto& [path, facts] : folders_) {
            const UniqueFd folder = OpenBeneath(tree_, path, kFolderFlags);
            const timespec times[] = {facts.st_mtim, facts.st_mtim};
            if (!folder || fchmod(folder.Get(), ModeOf(facts)) != 0 ||
                futimens(folder.Get(), times) != 0) {
                Fail("cannot finish a folder");
            }
        }
        return !folders_.empty();
    }

private:
    struct Source {
        int folder;
        const MovedNames& names;
    };

    void TakePlace(const Source& source, const std::string& place) {
        std::vector<std::string> folders;  // still to be looked into
        if (place.empty()) {
            folders.emplace_back();
        } else if (const UniqueFd above = Open(source.folder, PathAbove(place))) {
            TakeEntry(source, above.Get(), PathAbove(place), LastName(place), folders);
        }
        while (!folders.empty()) {
            const std::string folder = std::move(folders.back());
            folders.pop_back();
            const UniqueFd open = Open(source.folder, folder);
            if (!open) {
                continue;
            }
            const bool is_copy = source.folder == copy_;
            // A folder of versions was made when its first file came there.
            if (is_copy && Entry(open.Get(), "").StoodAt(at_)) {
                if (const auto then = WantedName(source, folder)) {
                    MakeFolder(source, *then);
                }
            }
            for (const std::string& name : NamesIn(open)) {
                if (!is_copy || !folder.empty() || !programs::IsReservedInShare(name)) {
                    TakeEntry(source, open.Get(), folder, name, folders);
                }
            }
        }
    }

    // What it was called that is at the path in the source; nothing when that is not wanted.
    std::optional<std::string> WantedName(const Source& source, const std::string& path) const {
        auto then = source.names.Then(path);
        return then && IsAtOrBelow(*then, path_) ? then : std::nullopt;
    }

    // Not open when no such folder is there.
    static UniqueFd Open(int source, const std::string& path) {
        UniqueFd folder = OpenBeneath(source, path, kFolderFlags);
        if (!folder && !IsGone()) {
            Fail("cannot open a folder of a copy");
        }
        return folder;
    }

    // The same, of a folder that was at `path` at the time.
    static UniqueFd OpenAsNamed(int source, const MovedNames& names, const std::string& path) {
        const auto now = source >= 0 ? names.Now(path) : std::nullopt;
        return now ? Open(source, *now) : UniqueFd();
    }

    // Whoever is not root has to get into its folders to remove them.
    static mode_t ModeOf(const struct stat& facts) {
        return (facts.st_mode & 07777) | (geteuid() == 0 ? 0 : 0700);
    }

    void TakeEntry(const Source& source, int folder, const std::string& above,
                   const std::string& name, std::vector<std::string>& folders) {
        const Entry entry(folder, name.c_str());
        std::string path = Below(above, name);
        if (entry.is_folder) {
            folders.push_back(std::move(path));
        } else if (entry.StoodAt(at_)) {
            const auto then = WantedName(source, path);
            if (then && MakeFolder(source, PathAbove(*then))) {
                Link(folder, name.c_str(), *then);
            }
        }
    }

    // The entry `name` of the open folder, as `then`.
    void Link(int folder, const char* name, const std::string& then) {
        const std::string path = PathAbove(then);
        const std::string linked = LastName(then);
        if (!target_ || target_path_ != path) {
            target_ = OpenBeneath(tree_, path, kFolderFlags);
            target_path_ = path;
            if (!target_) {
                Fail("cannot open a folder that was just made");
            }
        }
        if (linkat(folder, name, target_.Get(), linked.c_str(), 0) != 0) {
            // What is there already stood there.
            const int problem = errno;
            const bool became_folder = problem == EPERM && Entry(folder, name).is_folder;
            errno = problem;
            if (problem != EEXIST && !became_folder && !IsGone()) {
                Fail("cannot link a file of a copy");
            }
            return;
        }
        // Another file may have come in its place since it was looked at.
        if (!Entry(target_.Get(), linked.c_str()).StoodAt(at_)) {
            unlinkat(target_.Get(), linked.c_str(), 0);
        }
    }

    // Makes the folder and those above it, as they are in the copy; of one that is not there any
    // more, as they are in the source. False when a file stood in the place.
    bool MakeFolder(const Source& source, const std::string& path) {
        if (folders_.count(path) != 0) {
            return true;
        }
        if (!path.empty() && !MakeFolder(source, PathAbove(path))) {
            return false;
        }
        UniqueFd model = OpenAsNamed(copy_, present_, path);
        if (!model) {
            model = OpenAsNamed(source.folder, source.names, path);
        }
        if (!path.empty()) {
            const UniqueFd above = OpenBeneath(tree_, PathAbove(path), kFolderFlags);
            if (!above || mkdirat(above.Get(), LastName(path).c_str(), 0700) != 0) {
                if (above && errno == EEXIST) {
                    return false;
                }
                Fail("cannot make a folder");
            }
        }
        const UniqueFd made = OpenBeneath(tree_, path, kFolderFlags);
        struct stat facts = {};
        if (!made || fstat(model ? model.Get() : made.Get(), &facts) != 0 ||
            (geteuid() == 0 && fchown(made.Get(), facts.st_uid, facts.st_gid) != 0)) {
            Fail("cannot make a folder");
        }
        if (model && !CopyUserAttributes(model.Get(), made.Get())) {
            Fail("cannot set a folder's attributes");
        }
        folders_.emplace(path, facts);
        return true;
    }

    int tree_;
    int copy_;
    const MovedNames& present_;
    const std::string& path_;
    VersionTime at_;
    std::map<std::string, struct stat> folders_;  // that were made, and what they are to be like
    UniqueFd target_;                             // the folder of the tree that takes links
    std::string target_path_;
};

// What runs have replaced or deleted whose connections have not ended: later than any time.
std::vector<UniqueFd> UnfinishedVersions(const UniqueFd& copy) {
    std::vector<UniqueFd> folders;
    const UniqueFd left = OpenBeneath(copy.Get(), kVersionsInCopy, kFolderFlags);
    for (const std::string& name : left ? NamesIn(left) : std::vector<std::string>()) {
        UniqueFd folder = OpenBeneath(left.Get(), name, kFolderFlags);
        if (folder && IsVersionId(name)) {
            folders.push_back(std::move(folder));
        }
    }
    return folders;
}

// Returns whether there is anything in the tree.
bool Assemble(const PastTreeOrder& order, const UniqueFd& tree) {
    const UniqueFd copy = OpenFolder(AT_FDCWD, order.copy);
    if (!HaveVersions(order.share, order.copy)) {
        Fail("cannot make the folder of the versions of " + order.share);
    }
    const std::string all = VersionsOf(order.share, order.copy);
    const VersionsLock lock(all, LOCK_SH);  // nothing is moved meanwhile, no version given up
    const auto moves = lock ? ListMoves(all) : std::nullopt;
    if (!moves) {
        Fail("cannot read what was moved in " + order.share);
    }
    NamesOverTime to_present(*moves, order.at);
    const MovedNames& present = to_present.UntilNow();
    Assembly assembly(tree.Get(), copy.Get(), present, order);
    std::set<std::string> taken;
    const auto take_versions = [&] {
        const auto versions = ListVersions(all);
        if (!versions) {
            Fail("cannot list the versions of " + order.share);
        }
        NamesOverTime names(*moves, order.at);
        for (const VersionFolder& version : *versions) {
            const UniqueFd folder = order.at < version.time && taken.insert(version.path).second
                                        ? OpenFolder(AT_FDCWD, version.path)
                                        : UniqueFd();
            if (folder) {
                assembly.Take(folder.Get(), names.Until(version.time));
            }
        }
    };
    take_versions();
    std::vector<UniqueFd> unfinished;
    if (copy) {
        assembly.Take(copy.Get(), present);
        // Before the versions are listed: one that ends meanwhile is met twice, or as a version.
        unfinished = UnfinishedVersions(copy);
    }
    take_versions();
    for (const UniqueFd& folder : unfinished) {
        assembly.Take(folder.Get(), present);
    }
    return assembly.Finish();
}

// Held by whoever makes or removes the tree.
UniqueFd LockTree(const std::string& path) {
    UniqueFd tree = OpenFolder(AT_FDCWD, path);
    if (tree && flock(tree.Get(), LOCK_EX | LOCK_NB) != 0) {
        tree.Reset();
    }
    return tree;
}

void Remove(const std::string& path) {
    AllowManyFiles();
    RemoveTree(AT_FDCWD, path);
}

}  // namespace

std::string PastTreePath(const std::string& storage, const std::string& name) {
    return storage + "/" + kTreesInStorage + "/" + name;
}

PastTreeResult MakePastTree(const ServerConfig& config, const PastTreeOrder& order,
                            const std::string& name, UniqueFd& made) {
    const std::string path = PastTreePath(FolderAbove(order.copy), name);
    if (!MakeShareFolder(config, FolderAbove(path)) || !MakeShareFolder(config, path)) {
        Fail("cannot make " + path);
    }
    UniqueFd tree = LockTree(path);
    if (!tree) {
        Fail("cannot lock " + path);
    }
    PastTreeResult result = PastTreeResult::kNothing;
    try {
        if (Assemble(order, tree)) {
            made = std::move(tree);
            return PastTreeResult::kMade;
        }
    } catch (const NoBirthTime&) {
        result = PastTreeResult::kNoBirthTimes;
    } catch (...) {
        Remove(path);
        throw;
    }
    Remove(path);
    return result;
}

void RemovePastTrees(const ServerConfig& config,
                     const std::function<bool(const std::string& name)>& is_open) {
    for (const std::string& storage : config.Folders()) {
        std::error_code error;
        for (fs::directory_iterator entry(storage + "/" + kTreesInStorage, error), end;
             !error && entry != end; entry.increment(error)) {
            const std::string path = entry->path();
            // Whoever makes a tree opens its module before the lock is free.
            const UniqueFd lock = LockTree(path);
            if (lock && !is_open(entry->path().filename())) {
                Remove(path);
            }
        }
    }
}

}  // namespace zel_server
