#include "base/make_folder.h"

#include <sys/stat.h>

#include <cerrno>

namespace base {

namespace {

constexpr mode_t kForEverybody = 0755;

bool IsFolder(const std::string& path) {
    struct stat info = {};
    if (stat(path.c_str(), &info) != 0) {
        return false;
    }
    errno = ENOTDIR;
    return S_ISDIR(info.st_mode);
}

}  // namespace

bool MakeFolder(const std::string& path, mode_t mode) {
    if (IsFolder(path)) {
        return true;
    }
    const size_t slash = path.rfind('/');
    const bool has_parent = slash != 0 && slash != std::string::npos;
    if (errno != ENOENT || (has_parent && !MakeFolder(path.substr(0, slash), kForEverybody))) {
        return false;
    }
    // Somebody else may be making it at the same time.
    return (mkdir(path.c_str(), mode) == 0 && chmod(path.c_str(), mode) == 0) ||
           (errno == EEXIST && IsFolder(path));
}

}  // namespace base
