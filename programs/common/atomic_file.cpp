#include "programs/common/atomic_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "base/unique_fd.h"
#include "platform/internal/write_all.h"

namespace programs {

namespace {

using base::UniqueFd;

void SyncFolderOf(const std::string& path) {
    const UniqueFd folder(
        open(path.substr(0, path.rfind('/') + 1).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (folder) {
        fsync(folder.Get());
    }
}

}  // namespace

bool WriteFileAtomically(const std::string& path, const std::string& content, mode_t mode) {
    // A name without ".conf" at the end: the rsync daemon reads every *.conf of its folders.
    std::string temporary = path + ".XXXXXX";
    const UniqueFd file(mkostemp(temporary.data(), O_CLOEXEC));
    if (!file) {
        return false;
    }
    if (fchmod(file.Get(), mode) == 0 && tarq_internal::WriteAll(file.Get(), content) &&
        fsync(file.Get()) == 0 && rename(temporary.c_str(), path.c_str()) == 0) {
        SyncFolderOf(path);
        return true;
    }
    const int saved = errno;
    unlink(temporary.c_str());
    errno = saved;
    return false;
}

}  // namespace programs
