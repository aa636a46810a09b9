#include "programs/zelctl/prepare.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "tarq/root_path.h"

namespace zelctl {

namespace {

// Whether nobody but us and root can put another file in the place of one of ours.
bool IsOurs(const std::string& folder) {
    struct stat info = {};
    if (lstat(folder.c_str(), &info) != 0 || !S_ISDIR(info.st_mode) ||
        access(folder.c_str(), W_OK | X_OK) != 0) {
        return false;
    }
    const bool others_may_write = (info.st_mode & (S_IWGRP | S_IWOTH)) != 0;
    return (info.st_uid == geteuid() || info.st_uid == 0) &&
           (!others_may_write || (info.st_mode & S_ISVTX) != 0);
}

}  // namespace

ExitCode PrepareHost() {
    const std::string scratch = TARQ::RootPath("/tmp/ZEL");
    for (const std::string& folder :
         {TARQ::RootPath("/usr/tarq/etc"), TARQ::RootPath("/tmp"), TARQ::RootPath("/var/log")}) {
        std::error_code error;
        std::filesystem::create_directories(folder, error);
        if (error) {
            return Fail(kLocal,
                        "cannot make %s: %s; run it as root, or set TARQ_ROOT to a folder of yours",
                        folder.c_str(), error.message().c_str());
        }
    }
    if (mkdir(scratch.c_str(), 0700) != 0 && errno != EEXIST) {
        return Fail(kLocal, "cannot make %s: %s", scratch.c_str(), strerror(errno));
    }
    return IsOurs(scratch) ? kOk
                           : Fail(kLocal,
                                  "%s belongs to somebody else: remove it, or set TARQ_ROOT to a "
                                  "folder of yours",
                                  scratch.c_str());
}

}  // namespace zelctl
