#include "programs/zel_daemon/store_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <system_error>

#include "base/unique_fd.h"
#include "programs/zel_daemon/store_schema.h"

namespace zel_daemon {

namespace {

using base::UniqueFd;

constexpr char kMark[] = ".made";
constexpr char kNew[] = ".new";
constexpr char kLog[] = "-wal";

[[noreturn]] void ThrowErrno(const std::string& what) {
    throw std::system_error(errno, std::generic_category(), what);
}

bool IsThere(const std::string& path) {
    struct stat info = {};
    if (lstat(path.c_str(), &info) == 0) {
        return true;
    }
    if (errno != ENOENT) {
        ThrowErrno(path);
    }
    return false;
}

void RemoveFile(const std::string& path) {
    if (unlink(path.c_str()) != 0 && errno != ENOENT) {
        ThrowErrno(path);
    }
}

void Rename(const std::string& from, const std::string& to) {
    if (rename(from.c_str(), to.c_str()) != 0) {
        ThrowErrno(from);
    }
}

std::string FolderOf(const std::string& path) {
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? "." : path.substr(0, std::max<size_t>(slash, 1));
}

// An entry that was made in the folder survives a power cut from here on.
void SyncFolder(const std::string& folder) {
    const UniqueFd fd(open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd || fsync(fd.Get()) != 0) {
        ThrowErrno(folder);
    }
}

// SQLite gives its own files beside the file the file's mode.
void MakePrivateFile(const std::string& path) {
    if (!UniqueFd(open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600))) {
        ThrowErrno(path);
    }
}

void MakeStoreFile(const std::string& path) {
    const std::string fresh = path + kNew;
    RemoveFile(fresh);
    RemoveFile(fresh + "-journal");
    MakePrivateFile(fresh);
    {
        Database database(fresh);
        BringUpToDate(database, StoreSchema());
    }
    Rename(fresh, path);
    SyncFolder(FolderOf(path));
}

}  // namespace

void PrepareStoreFile(const std::string& path) {
    const std::string folder = FolderOf(path);
    if (mkdir(folder.c_str(), 0700) == 0) {
        SyncFolder(FolderOf(folder));
    } else if (errno != EEXIST) {
        ThrowErrno(folder);
    }
    if (!IsThere(path)) {
        for (const char* const trace : {kMark, kLog}) {
            if (IsThere(path + trace)) {
                throw LostStore("it is gone, though it was there (" + path + trace + " tells)");
            }
        }
        MakeStoreFile(path);
    }
    struct stat info = {};
    if (stat(path.c_str(), &info) != 0) {
        ThrowErrno(path);
    }
    // SQLite would take it for a new database, and throw away the log of changes.
    if (info.st_size == 0) {
        throw LostStore("it is empty, its content is lost");
    }
    if ((info.st_mode & 0077) != 0 && chmod(path.c_str(), 0600) != 0) {
        ThrowErrno(path);
    }
}

void MarkStoreFile(const std::string& path) {
    if (!IsThere(path + kMark)) {
        MakePrivateFile(path + kMark);
        SyncFolder(FolderOf(path));
    }
}

std::string PutStoreAside(const std::string& path) {
    const std::string aside = path + ".lost-" + std::to_string(time(nullptr));
    bool moved = false;
    for (const char* const part : {"", kLog, "-shm"}) {
        if (IsThere(path + part)) {
            Rename(path + part, aside + part);
            moved = true;
        }
    }
    RemoveFile(path + kMark);
    return moved ? aside : "";
}

}  // namespace zel_daemon
