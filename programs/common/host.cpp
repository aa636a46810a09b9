#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "programs/common/host.h"
#include "programs/common/text.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"

namespace programs {

namespace {

constexpr int kAttempts = 3;

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

// Puts a folder of ours in the place of what somebody else has put there, in one step, so that he
// cannot be first once more. What was there lies beside it then, under a name that is told. Only
// who may rename what lies in the folder above can do that: root, in /tmp. False with errno.
bool PutAside(const std::string& path) {
    std::string aside = path + ".XXXXXX";
    if (mkdtemp(aside.data()) == nullptr) {
        return false;
    }
    if (renameat2(AT_FDCWD, aside.c_str(), AT_FDCWD, path.c_str(), RENAME_EXCHANGE) != 0) {
        const int reason = errno;
        rmdir(aside.c_str());
        errno = reason;
        return false;
    }
    ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_WARNING,
                        "[WARNING] host(%d): %s belonged to somebody else; it is %s now\n",
                        __LINE__, path.c_str(), aside.c_str());
    return true;
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
    // What is in the way may go at any moment.
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        if (mkdir(scratch.c_str(), 0700) == 0) {
            return "";
        }
        if (errno != EEXIST) {
            return "cannot make " + scratch + ": " + strerror(errno) +
                   (errno == EROFS ? " (systemctl restart zel_daemon makes it anew)" : "");
        }
        if (IsOurs(scratch) || PutAside(scratch)) {
            return "";
        }
    }
    return scratch + " belongs to somebody else: remove it, or set TARQ_ROOT to a folder of yours";
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
