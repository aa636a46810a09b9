#include "platform/tarqcore/atomic_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <sys/file.h>
#include <unistd.h>

#include "base/unique_fd.h"
#include "platform/internal/error.h"

namespace tarqcore {
namespace {

using base::UniqueFd;
using tarq_internal::Fail;

// Names that writers of one file may hold at the same time.
constexpr int kTemporaryNames = 16;
constexpr mode_t kNewFileMode = 0644;
constexpr mode_t kModeBits = 07777;

/// A new file in a folder, beside the one that it is to replace. Removed when destroyed, unless it
/// was renamed.
///
/// The names are few and fixed, so that what a killed writer left behind is found and removed by
/// the next one. A writer holds a lock on its file: a file that is not locked has no writer.
class TemporaryFile {
public:
    TemporaryFile(int folder, const std::string& target) : folder_(folder), target_(target) {}
    TemporaryFile(const TemporaryFile&) = delete;
    TemporaryFile& operator=(const TemporaryFile&) = delete;
    ~TemporaryFile() {
        if (fd_) {
            const int saved = errno;
            unlinkat(folder_, name_.c_str(), 0);
            errno = saved;
        }
    }

    bool Create(mode_t mode) {
        for (int attempt = 0; attempt < kTemporaryNames; ++attempt) {
            name_ = "." + target_ + ".tmp" + std::to_string(attempt);
            RemoveAbandoned();
            UniqueFd fd(openat(folder_, name_.c_str(),
                               O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, mode));
            if (!fd && errno != EEXIST) {
                return false;
            }
            // Between the two calls somebody may have taken the file for abandoned.
            if (fd && Holds(fd.Get())) {
                fd_ = std::move(fd);
                return true;
            }
        }
        errno = EBUSY;
        return false;
    }

    bool TakeOwnerAndMode(const struct stat& of) {
        struct stat own {};
        if (fstat(fd_.Get(), &own) != 0) {
            return false;
        }
        const bool same_owner = own.st_uid == of.st_uid && own.st_gid == of.st_gid;
        // The owner first: a change of owner clears the mode's upper bits.
        return (same_owner || fchown(fd_.Get(), of.st_uid, of.st_gid) == 0) &&
               fchmod(fd_.Get(), of.st_mode & kModeBits) == 0;
    }

    bool Write(std::string_view bytes) {
        while (!bytes.empty()) {
            const ssize_t n = write(fd_.Get(), bytes.data(), bytes.size());
            if (n > 0) {
                bytes.remove_prefix(static_cast<size_t>(n));
            } else if (n == 0) {
                errno = ENOSPC;  // a write that takes nothing and gives no reason would be tried
                                 // for ever
                return false;
            } else if (errno != EINTR) {
                return false;
            }
        }
        return true;
    }

    bool Flush() { return fsync(fd_.Get()) == 0; }

    bool RenameToTarget() {
        if (renameat(folder_, name_.c_str(), folder_, target_.c_str()) != 0) {
            return false;
        }
        fd_.Reset();
        return true;
    }

private:
    /// Takes the lock on `fd`; true when the name still stands for that file.
    bool Holds(int fd) const {
        struct stat own {};
        struct stat named {};
        return flock(fd, LOCK_EX | LOCK_NB) == 0 && fstat(fd, &own) == 0 &&
               fstatat(folder_, name_.c_str(), &named, AT_SYMLINK_NOFOLLOW) == 0 &&
               own.st_dev == named.st_dev && own.st_ino == named.st_ino;
    }

    void RemoveAbandoned() const {
        const UniqueFd left(openat(folder_, name_.c_str(),
                                   O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
        if (left && Holds(left.Get())) {
            unlinkat(folder_, name_.c_str(), 0);
        }
    }

    int folder_;
    const std::string& target_;
    std::string name_;
    UniqueFd fd_;
};

/// Flushes the folder's entries. Some file systems have nothing to flush there and say so.
bool FlushFolder(int folder) {
    return fsync(folder) == 0 || errno == EINVAL || errno == ENOSYS;
}

}  // namespace

bool ReplaceFile(const std::string& path, const struct stat* old,
                 const std::vector<std::string_view>& content) {
    const size_t slash = path.rfind('/');
    const bool bare = slash == std::string::npos;
    const std::string folder_path = bare ? "." : path.substr(0, slash + 1);
    const std::string name = bare ? path : path.substr(slash + 1);
    const auto fail = [] {
        Fail(TARQ_ERR_WRITE_FILE);
        return false;
    };

    const UniqueFd folder(open(folder_path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!folder) {
        return fail();
    }
    TemporaryFile file(folder.Get(), name);
    // Nobody else may look into the new file before it has the old one's mode.
    if (!file.Create(old != nullptr ? 0600 : kNewFileMode)) {
        return fail();
    }
    for (const std::string_view piece : content) {
        if (!file.Write(piece)) {
            return fail();
        }
    }
    if ((old != nullptr && !file.TakeOwnerAndMode(*old)) || !file.Flush() ||
        !file.RenameToTarget() || !FlushFolder(folder.Get())) {
        return fail();
    }
    return true;
}

}  // namespace tarqcore
