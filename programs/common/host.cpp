#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "ZEL/zel.h"
#include "programs/common/task_run.h"
#include "programs/common/text.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"

namespace programs {

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

std::string PrepareHost() {
    const std::string scratch = TARQ::RootPath("/tmp/ZEL");
    for (const std::string& folder :
         {TARQ::RootPath("/usr/tarq/etc"), TARQ::RootPath("/tmp"), TARQ::RootPath("/var/log")}) {
        std::error_code error;
        std::filesystem::create_directories(folder, error);
        if (error) {
            return "cannot make " + folder + ": " + error.message() +
                   "; run it as root, or set TARQ_ROOT to a folder of yours";
        }
    }
    if (mkdir(scratch.c_str(), 0700) != 0 && errno != EEXIST) {
        return "cannot make " + scratch + ": " + strerror(errno);
    }
    return IsOurs(scratch) ? ""
                           : scratch +
                                 " belongs to somebody else: remove it, or set TARQ_ROOT to a "
                                 "folder of yours";
}

std::string ShareProblem(const std::string& name) {
    const std::string shown = "share '" + Printable(name) + "'";
    TARQShare record = nullptr;
    const int found = TARQShareGet(name.c_str(), &record);
    const TARQ::ShareOwner share(record);
    if (found < 0 || !share || share->path == nullptr) {
        const int error = KAPICErrGet();
        const std::string remedy =
            error == TARQ_ERR_SHARE_IDENTITY
                ? "if it is the right one: zelctl share confirm " + Printable(name)
                : "see 'zelctl share list'";
        return shown + ": " + KAPICErrText(error) + " (" + remedy + ")";
    }
    if (access(share->path, R_OK | X_OK) != 0) {
        return shown + ": its folder " + Printable(share->path) +
               " cannot be read: " + strerror(errno);
    }
    bool fit = false;
    if (ZEL::IsValidShare(name, fit) != 0) {
        return shown + ": " + KAPICErrText(KAPICErrGet());
    }
    return fit ? ""
               : shown +
                     " lies on a removable or network disk: only shares on this machine's own "
                     "disks are pushed";
}

}  // namespace programs
