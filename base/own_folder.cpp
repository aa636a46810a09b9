#include "base/own_folder.h"

#include <sys/stat.h>
#include <unistd.h>

namespace base {

bool IsOwnFolder(const std::string& path) {
    struct stat info {};
    if (lstat(path.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
        return false;
    }
    const bool others_may_write = (info.st_mode & (S_IWGRP | S_IWOTH)) != 0;
    return (info.st_uid == 0 || info.st_uid == geteuid()) &&
           (!others_may_write || (info.st_mode & S_ISVTX) != 0);
}

}  // namespace base
