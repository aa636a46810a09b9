#include "programs/zel_server/file_tree.h"

#include <fcntl.h>
#include <linux/limits.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "base/folder_names.h"

namespace zel_server {

base::UniqueFd OpenFolder(int above, const std::string& name) {
    return base::UniqueFd(
        openat(above, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
}

base::UniqueFd HaveFolder(int above, const std::string& name) {
    struct stat info = {};
    if (fstat(above, &info) != 0) {
        return base::UniqueFd();
    }
    const bool made = mkdirat(above, name.c_str(), 0700) == 0;
    if (!made && errno != EEXIST) {
        return base::UniqueFd();
    }
    base::UniqueFd folder = OpenFolder(above, name);
    if (made && folder) {
        const timespec times[] = {info.st_atim, info.st_mtim};
        futimens(above, times);
        if (info.st_uid != geteuid() && fchown(folder.Get(), info.st_uid, info.st_gid) != 0) {
            return base::UniqueFd();
        }
    }
    return folder;
}

std::string Below(const std::string& folder, const std::string& name) {
    return folder.empty() ? name : folder + "/" + name;
}

std::string PathAbove(const std::string& path) {
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? "" : path.substr(0, slash);
}

std::string LastName(const std::string& path) {
    return path.substr(path.rfind('/') + 1);
}

bool IsAtOrBelow(const std::string& path, const std::string& above) {
    return above.empty() || (path.compare(0, above.size(), above) == 0 &&
                             (path.size() == above.size() || path[above.size()] == '/'));
}

bool CopyUserAttributes(int from, int to) {
    const ssize_t size = flistxattr(from, nullptr, 0);
    std::string names(static_cast<size_t>(std::max<ssize_t>(size, 0)), '\0');
    const ssize_t listed = flistxattr(from, names.data(), names.size());
    if (listed < 0 && errno != EOPNOTSUPP) {
        return false;
    }
    names.resize(static_cast<size_t>(std::max<ssize_t>(listed, 0)));
    for (size_t at = 0; at < names.size(); at += strlen(&names[at]) + 1) {
        const char* const name = &names[at];
        std::string value(XATTR_SIZE_MAX, '\0');
        const ssize_t length = fgetxattr(from, name, value.data(), value.size());
        if (strncmp(name, "user.", 5) == 0 && length >= 0 &&
            fsetxattr(to, name, value.data(), static_cast<size_t>(length), 0) != 0) {
            return false;
        }
    }
    return true;
}

bool RemoveTree(int above, const std::string& name) {
    if (unlinkat(above, name.c_str(), 0) == 0 || errno == ENOENT) {
        return true;
    }
    const base::UniqueFd folder = OpenFolder(above, name);
    const auto names = folder ? base::NamesIn(folder.Get()) : std::nullopt;
    if (!names) {
        return false;
    }
    bool all = true;
    for (const std::string& below : *names) {
        all = RemoveTree(folder.Get(), below) && all;
    }
    return all && unlinkat(above, name.c_str(), AT_REMOVEDIR) == 0;
}

void AllowManyFiles() {
    rlimit limit = {};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
}

}  // namespace zel_server
