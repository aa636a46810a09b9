#include "programs/zel_server/partial_store.h"

#include <fcntl.h>
#include <sys/fsuid.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <optional>
#include <set>

#include "base/folder_names.h"
#include "base/open_beneath.h"
#include "base/random_digits.h"
#include "base/unique_fd.h"
#include "programs/common/share_path.h"
#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/share_module.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

using base::UniqueFd;

constexpr char kKept[] = "kept";
constexpr char kPath[] = "path";  // a symbolic link that leads there, read and never followed
constexpr size_t kSuffix = sizeof ".XXXXXX" - 1;  // of rsync's temporary names
// Less is sent again as fast as it is found.
constexpr off_t kWorthKeeping = off_t{1} << 20;
// A run has lost its client when that one says that it broke, and nothing has come for so long.
constexpr time_t kSilent = 20;
// How often those are looked at that are about to end.
constexpr int kWritersSteps = 60;
constexpr timespec kWritersStep = {0, 50'000'000};

// Whether `file` is how rsync calls what it has of `name`. It cuts long names.
bool IsPartOf(const std::string& file, const std::string& name) {
    const size_t dot = file.size() - std::min(file.size(), kSuffix);
    return dot > 0 && file[dot] == '.' &&
           (name == file.substr(0, dot) ||
            (file.size() > NAME_MAX - kSuffix && name.compare(0, dot, file, 0, dot) == 0));
}

// A regular file of one name; nothing for all else.
std::optional<struct stat> PlainFile(int folder, const std::string& name) {
    struct stat info = {};
    if (fstatat(folder, name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(info.st_mode) ||
        info.st_nlink != 1) {
        return std::nullopt;
    }
    return info;
}

// The kernel gives nobody a lease on a file that somebody has open for writing. Only the file's
// owner may ask.
bool NobodyWrites(int folder, const std::string& name) {
    const UniqueFd file(
        openat(folder, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat info = {};
    if (!file || fstat(file.Get(), &info) != 0) {
        return false;
    }
    // Whoever opens it in this moment has the kernel tell this process, which must not end it.
    signal(SIGIO, SIG_IGN);
    const int own = setfsuid(info.st_uid);
    const bool leased = fcntl(file.Get(), F_SETLEASE, F_RDLCK) == 0;
    setfsuid(static_cast<uid_t>(own));
    if (leased) {
        fcntl(file.Get(), F_SETLEASE, F_UNLCK);
    }
    return leased;
}

// Removes the folder if it is empty. The time of the one above stays.
void RemoveEmpty(int above, const char* name) {
    struct stat info = {};
    if (fstat(above, &info) == 0 && unlinkat(above, name, AT_REMOVEDIR) == 0) {
        const std::array<timespec, 2> times = {info.st_atim, info.st_mtim};
        futimens(above, times.data());
    }
}

class Partials {
public:
    explicit Partials(const std::string& copy)
        : top_(OpenFolder(AT_FDCWD, copy)),
          reserved_(top_ ? OpenFolder(top_.Get(), TARQ::Backup::kPartialsFolder) : UniqueFd()) {}

    bool Have(const std::string& id) {
        if (top_ && !reserved_) {
            reserved_ = HaveFolder(top_.Get(), TARQ::Backup::kPartialsFolder);
        }
        return reserved_ && HaveFolder(reserved_.Get(), id);
    }

    explicit operator bool() const { return static_cast<bool>(reserved_); }

    // The path of the file that is kept; empty: none is.
    std::string Path() const {
        std::array<char, PATH_MAX> target = {};
        const ssize_t size = readlinkat(reserved_.Get(), kPath, target.data(), target.size());
        const std::string path(target.data(), size > 0 ? static_cast<size_t>(size) : 0);
        return size < PATH_MAX && !programs::IsReservedInShare(path) ? path : "";
    }

    bool Place() const {
        const std::string path = Path();
        const UniqueFd folder = base::OpenBeneath(top_.Get(), PathAbove(path), O_RDONLY);
        const UniqueFd beside = path.empty() || !folder
                                    ? UniqueFd()
                                    : HaveFolder(folder.Get(), TARQ::Backup::kResumedFolder);
        return beside && PlainFile(reserved_.Get(), kKept) &&
               NobodyWrites(reserved_.Get(), kKept) &&
               renameat2(reserved_.Get(), kKept, beside.Get(), LastName(path).c_str(),
                         RENAME_NOREPLACE) == 0;
    }

    void TakeBack() const {
        const std::string path = Path();
        const UniqueFd folder =
            path.empty() ? UniqueFd() : base::OpenBeneath(top_.Get(), PathAbove(path), O_RDONLY);
        const UniqueFd beside =
            folder ? OpenFolder(folder.Get(), TARQ::Backup::kResumedFolder) : UniqueFd();
        if (!beside) {
            return;
        }
        if (PlainFile(beside.Get(), LastName(path)) && NobodyWrites(beside.Get(), LastName(path))) {
            renameat(beside.Get(), LastName(path).c_str(), reserved_.Get(), kKept);
        }
        RemoveEmpty(folder.Get(), TARQ::Backup::kResumedFolder);
    }

    // Waits a moment for runs that still write a part of one of these files: their client has left
    // them. Those that have long got nothing are ended.
    void AwaitWriters(const std::string& share, const std::vector<std::string>& paths) const {
        std::set<pid_t> ended;
        for (int i = 0; i < kWritersSteps; ++i) {
            bool any = false;
            for (const auto& [id, process] : TransfersInto(share)) {
                const auto last = LastWritten(id, paths);
                any = any || last;
                if (last && time(nullptr) - *last >= kSilent && ended.insert(process).second) {
                    kill(-process, SIGTERM);  // rsync keeps what it has
                }
            }
            if (!any) {
                return;
            }
            nanosleep(&kWritersStep, nullptr);
        }
    }

    // Keeps the largest part of the file at `path`, if there is one.
    bool Keep(const std::string& path) const {
        const auto kept = Path() == path ? PlainFile(reserved_.Get(), kKept) : std::nullopt;
        off_t largest = kept ? kept->st_size : 0;
        UniqueFd from;
        std::string name;
        for (const std::string& id : Names(reserved_)) {
            UniqueFd folder =
                base::AreRandomDigits(id) ? OpenFolder(reserved_.Get(), id) : UniqueFd();
            for (const std::string& file : Names(folder)) {
                const auto info =
                    IsPartOf(file, LastName(path)) ? PlainFile(folder.Get(), file) : std::nullopt;
                if (info && info->st_size > largest && NobodyWrites(folder.Get(), file)) {
                    largest = info->st_size;
                    name = file;
                    from = UniqueFd(dup(folder.Get()));
                }
            }
        }
        if (largest < kWorthKeeping) {
            return false;
        }
        if (from) {
            unlinkat(reserved_.Get(), kPath, 0);
            if (renameat(from.Get(), name.c_str(), reserved_.Get(), kKept) != 0 ||
                symlinkat(path.c_str(), reserved_.Get(), kPath) != 0) {
                return false;
            }
        }
        // rsync writes into it, whatever mode it has given it.
        return fchmodat(reserved_.Get(), kKept, 0600, 0) == 0;
    }

    // Removes the folders of runs that have ended: all, or those of which nothing was changed since
    // `before`.
    void RemoveEnded(const std::string& share, std::optional<time_t> before = {}) const {
        const auto running = TransfersInto(share);
        for (const std::string& id : Names(reserved_)) {
            if (base::AreRandomDigits(id) && running.count(id) == 0 && IsBefore(id, before)) {
                RemoveTree(reserved_.Get(), id);
            }
        }
    }

    void RemoveKept(std::optional<time_t> before = {}) const {
        if (IsBefore(kKept, before)) {
            unlinkat(reserved_.Get(), kKept, 0);
            unlinkat(reserved_.Get(), kPath, 0);
        }
    }

    void RemoveEmptyFolders(const std::string& share) const {
        const auto running = TransfersInto(share);
        for (const std::string& id : Names(reserved_)) {
            if (base::AreRandomDigits(id) && running.count(id) == 0) {
                RemoveEmpty(reserved_.Get(), id.c_str());
            }
        }
    }

private:
    static std::vector<std::string> Names(const UniqueFd& folder) {
        return folder ? base::NamesIn(folder.Get()).value_or(std::vector<std::string>())
                      : std::vector<std::string>();
    }

    bool IsBefore(const std::string& name, std::optional<time_t> time) const {
        struct stat info = {};
        return !time || (fstatat(reserved_.Get(), name.c_str(), &info, AT_SYMLINK_NOFOLLOW) == 0 &&
                         info.st_ctime < *time);
    }

    // When the run has last written into a part of one of these files; nothing when it writes none.
    std::optional<time_t> LastWritten(const std::string& id,
                                      const std::vector<std::string>& paths) const {
        const UniqueFd folder = OpenFolder(reserved_.Get(), id);
        const std::vector<std::string> files = Names(folder);
        for (const std::string& file : files) {
            for (const std::string& path : paths) {
                const auto info =
                    IsPartOf(file, LastName(path)) ? PlainFile(folder.Get(), file) : std::nullopt;
                if (info && !NobodyWrites(folder.Get(), file)) {
                    return info->st_mtime;
                }
            }
        }
        const std::string resumed = Path();
        if (!files.empty() || std::find(paths.begin(), paths.end(), resumed) == paths.end()) {
            return std::nullopt;
        }
        const UniqueFd beside = base::OpenBeneath(
            top_.Get(), Below(PathAbove(resumed), TARQ::Backup::kResumedFolder), O_RDONLY);
        const auto info = beside ? PlainFile(beside.Get(), LastName(resumed)) : std::nullopt;
        return info && !NobodyWrites(beside.Get(), LastName(resumed))
                   ? std::optional<time_t>(info->st_mtime)
                   : std::nullopt;
    }

    UniqueFd top_;
    UniqueFd reserved_;
};

}  // namespace

bool PreparePartials(const std::string& copy, const std::string& id, bool resumes) {
    Partials partials(copy);
    return partials.Have(id) && (!resumes || partials.Place());
}

void SettlePartials(const std::string& share, const std::string& copy) {
    if (const Partials partials{copy}) {
        // Another run may be about to go on with it.
        if (TransfersInto(share).empty()) {
            partials.TakeBack();
        }
        partials.RemoveEmptyFolders(share);
    }
}

void AwaitBrokenRuns(const std::string& share, const std::string& copy,
                     const std::vector<std::string>& broken) {
    if (const Partials partials{copy}) {
        partials.AwaitWriters(share, broken);
    }
}

std::string OfferPartial(const std::string& share, const std::string& copy,
                         const std::vector<std::string>& broken) {
    const Partials partials(copy);
    if (!partials || broken.empty()) {
        return "";
    }
    partials.TakeBack();
    std::string offered;
    for (const std::string& path : broken) {
        if (offered.empty() && partials.Keep(path)) {
            offered = path;
        }
    }
    partials.RemoveEnded(share);
    if (offered.empty()) {
        partials.RemoveKept();
    }
    return offered;
}

void RemovePartials(const std::string& share, const std::string& copy) {
    if (const Partials partials{copy}) {
        partials.TakeBack();
        partials.RemoveKept();
        partials.RemoveEnded(share);
    }
}

void RemoveStalePartials(const std::string& share, const std::string& copy) {
    const Partials partials(copy);
    if (partials && TransfersInto(share).empty()) {
        const time_t before = time(nullptr) - kPartialsStale;
        partials.TakeBack();
        partials.RemoveKept(before);
        partials.RemoveEnded(share, before);
    }
}

}  // namespace zel_server
