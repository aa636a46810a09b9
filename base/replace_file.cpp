#include "base/replace_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>

#include "base/unique_fd.h"
#include "base/whole_file.h"

namespace base {
namespace {

// Names that writers of one file may hold at the same time.
constexpr int kTemporaryNames = 16;
constexpr mode_t kNewFileMode = 0644;
constexpr mode_t kPrivateMode = 0600;
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

    /// Nobody else may open the new file: he could lock it, look into it before it has its mode,
    /// and keep its name from all later writers.
    bool Create() {
        struct stat there {};
        if (fstatat(folder_, target_.c_str(), &there, 0) == 0 && !S_ISREG(there.st_mode)) {
            errno = S_ISDIR(there.st_mode) ? EISDIR : ENOTSUP;  // no device, nor a link to one
            return false;
        }
        for (int attempt = 0; attempt < kTemporaryNames; ++attempt) {
            name_ = "." + target_ + ".tmp" + std::to_string(attempt);
            RemoveAbandoned();
            UniqueFd fd(openat(folder_, name_.c_str(),
                               O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, kPrivateMode));
            if (!fd && errno != EEXIST) {
                return false;
            }
            // Between the two calls somebody may have taken the file for abandoned. A file system
            // that has no locks has nobody who does.
            if (fd && (Lock(fd.Get()) || errno != EWOULDBLOCK) && IsCalledSo(fd.Get())) {
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
               SetMode(of.st_mode & kModeBits);
    }

    bool SetMode(mode_t mode) { return fchmod(fd_.Get(), mode) == 0; }

    bool Write(std::string_view bytes) { return WriteAll(fd_.Get(), bytes); }

    bool Flush() { return fsync(fd_.Get()) == 0; }

    bool RenameToTarget() {
        if (renameat(folder_, name_.c_str(), folder_, target_.c_str()) != 0) {
            return false;
        }
        fd_.Reset();
        return true;
    }

private:
    static bool Lock(int fd) { return flock(fd, LOCK_EX | LOCK_NB) == 0; }

    /// Whether the name stands for the file of `fd`.
    bool IsCalledSo(int fd) const {
        struct stat own {};
        struct stat named {};
        return fstat(fd, &own) == 0 &&
               fstatat(folder_, name_.c_str(), &named, AT_SYMLINK_NOFOLLOW) == 0 &&
               own.st_dev == named.st_dev && own.st_ino == named.st_ino;
    }

    void RemoveAbandoned() const {
        const UniqueFd left(openat(folder_, name_.c_str(),
                                   O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
        if (left && Lock(left.Get()) && IsCalledSo(left.Get())) {
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

/// 0644 with the process's umask applied. The umask is read from /proc: the system call that
/// returns it also sets it, for all threads.
mode_t NewFileMode() {
    constexpr std::string_view kUmask = "\nUmask:";
    const std::string status = ReadFile("/proc/self/status").value_or("");
    const size_t at = status.find(kUmask);
    return at == std::string::npos
               ? kPrivateMode
               : kNewFileMode &
                     ~static_cast<mode_t>(strtoul(status.c_str() + at + kUmask.size(), nullptr, 8));
}

/// `prepare` gives the new file its owner and mode.
template <typename Prepare>
bool Replace(const std::string& path, const std::vector<std::string_view>& content,
             Prepare&& prepare) {
    const size_t slash = path.rfind('/');
    const bool bare = slash == std::string::npos;
    const std::string name = bare ? path : path.substr(slash + 1);
    const UniqueFd folder(
        open(bare ? "." : path.substr(0, slash + 1).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!folder) {
        return false;
    }
    TemporaryFile file(folder.Get(), name);
    return file.Create() &&
           std::all_of(content.begin(), content.end(),
                       [&](std::string_view piece) { return file.Write(piece); }) &&
           prepare(file) && file.Flush() && file.RenameToTarget() && FlushFolder(folder.Get());
}

}  // namespace

bool ReplaceFile(const std::string& path, const std::vector<std::string_view>& content,
                 const struct stat* old) {
    return Replace(path, content, [&](TemporaryFile& file) {
        return old != nullptr ? file.TakeOwnerAndMode(*old) : file.SetMode(NewFileMode());
    });
}

bool ReplaceFile(const std::string& path, std::string_view content, mode_t mode) {
    return Replace(path, {content}, [&](TemporaryFile& file) { return file.SetMode(mode); });
}

}  // namespace base
