#include <pthread.h>
#include <sys/stat.h>
#include <syslog.h>
#include <tarq/root_path.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <map>
#include <mutex>

#include "base/file_lock.h"
#include "platform/internal/error.h"

// A semaphore is a lock file in a folder that only root, or the owner of the root folder, can
// enter. A System V semaphore would be anybody's: whoever comes first owns the key and can stop all
// others.

using tarq_internal::Fail;
using tarq_internal::Guarded;

namespace {

constexpr char kParent[] = "/run";
constexpr char kFolder[] = "/run/tarqcore";
constexpr mode_t kParentMode = 0755;
constexpr mode_t kFolderMode = 0700;
constexpr mode_t kOthersMayWrite = 0022;
// Writers hold it for milliseconds. One that does not let go has stopped.
constexpr std::chrono::seconds kLongestWait(20);

int Report(const std::string& problem) {
    const int reason = errno;
    syslog(LOG_ERR, "tarqcore: %s", problem.c_str());
    errno = reason;
    return Fail(TARQ_ERR_SEMAPHORE);
}

/// Makes the folder of the lock files. False with errno and `problem` set when it cannot be made,
/// or is one in which others could put another file in a lock's place.
bool PrepareFolder(const std::string& folder, std::string& problem) {
    const std::string root = TARQ::RootFolder();
    struct stat owner {};
    struct stat info {};
    if (stat(root.empty() ? "/" : root.c_str(), &owner) != 0) {
        problem = "cannot look at " + root + ": " + strerror(errno);
        return false;
    }
    for (const auto& [path, mode] :
         {std::pair(root + kParent, kParentMode), std::pair(folder, kFolderMode)}) {
        const bool made = mkdir(path.c_str(), mode) == 0;
        if (!made && errno != EEXIST) {
            problem = "cannot make " + path + ": " + strerror(errno);
            return false;
        }
        // In somebody's root folder, what root makes is his.
        if (made && geteuid() == 0 && owner.st_uid != 0 &&
            lchown(path.c_str(), owner.st_uid, owner.st_gid) != 0) {
            problem = "cannot give " + path + " to its owner: " + strerror(errno);
            return false;
        }
    }
    if (lstat(folder.c_str(), &info) != 0) {
        problem = "cannot look at " + folder + ": " + strerror(errno);
        return false;
    }
    const bool trusted = info.st_uid == 0 || info.st_uid == geteuid() ||
                         (geteuid() == 0 && info.st_uid == owner.st_uid);
    if (!S_ISDIR(info.st_mode) || !trusted || (info.st_mode & kOthersMayWrite) != 0) {
        problem = folder + " is not a folder that only root or its owner can write: remove it";
        errno = EPERM;
        return false;
    }
    return true;
}

std::string FileOf(int id) {
    char name[32];
    snprintf(name, sizeof name, "/semaphore.%08x", static_cast<unsigned int>(id));
    return TARQ::RootPath(kFolder) + name;
}

/// The semaphores that this process holds. The child of a fork() holds none: its parent does.
class Held {
public:
    Held() {
        pthread_atfork([] { instance.guard_.lock(); }, [] { instance.guard_.unlock(); },
                       [] {
                           for (auto& [id, lock] : instance.locks_) {
                               lock.Forget();
                           }
                           instance.locks_.clear();
                           instance.guard_.unlock();
                       });
    }
    void Put(int id, base::FileLock lock) {
        const std::lock_guard own(guard_);
        locks_[id] = std::move(lock);
    }
    bool GiveBack(int id) {
        const std::lock_guard own(guard_);
        return locks_.erase(id) == 1;
    }

    static Held instance;

private:
    std::mutex guard_;
    std::map<int, base::FileLock> locks_;
};
Held Held::instance;

int Refuse(int reason) {
    errno = reason;
    return Fail(TARQ_ERR_BAD_PARAMETER);
}

}  // namespace

// An id is the key: nothing is held open.
int KAPICSemOpen(int key) {
    if (key <= 0) {  // 0 asks System V for a new one each time, shared with nobody
        return Refuse(EINVAL);
    }
    return Guarded(-1, [&] {
        std::string problem;
        return PrepareFolder(TARQ::RootPath(kFolder), problem) ? key : Report(problem);
    });
}

int KAPICSemLock(int id) {
    return Guarded(-1, [&] {
        base::FileLock lock(FileOf(id), kLongestWait);
        if (!lock) {
            return Report(lock.Problem());
        }
        Held::instance.Put(id, std::move(lock));
        return 0;
    });
}

int KAPICSemUnlock(int id) {
    return Guarded(-1, [&] {
        if (Held::instance.GiveBack(id)) {
            return 0;
        }
        errno = EPERM;
        return Fail(TARQ_ERR_SEMAPHORE);
    });
}

int KAPICSemClose(int id) {
    return id > 0 ? 0 : Refuse(EINVAL);
}
