#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <vector>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "base/own_folder.h"
#include "base/unique_fd.h"
#include "programs/common/host.h"
#include "programs/common/text.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"

namespace programs {

namespace {

constexpr int kAttempts = 3;

// Whether only we and root can replace a file in that folder.
bool IsOurs(const std::string& folder) {
    return base::IsOwnFolder(folder) && access(folder.c_str(), W_OK | X_OK) == 0;
}

// Atomically exchanges a folder of another user for one of ours, so that the other user cannot
// create it again in between. The old one is kept under a name that is logged. It takes the right
// to rename entries of the parent folder: in /tmp, only root has it. False, with errno set, on
// failure.
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
    // The obstacle may disappear at any time, so there are several attempts.
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

int LackOfDescriptors(unsigned int count) {
    std::vector<base::UniqueFd> held(count);
    for (base::UniqueFd& fd : held) {
        fd = base::UniqueFd(open("/", O_PATH | O_CLOEXEC));
        if (!fd) {
            return errno;
        }
    }
    return 0;
}

std::string ShareProblem(const std::string& name) {
    const std::string shown = "share '" + Printable(name) + "'";
    TARQShare record = nullptr;
    const int found = TARQShareGet(name.c_str(), &record);
    const TARQ::ShareOwner share(record);
    if (found < 0 || !share || share->path == nullptr) {
        const int error = KAPICErrGet();
        // Who could open nothing has seen nothing of the share.
        if (const int lack = LackOfDescriptors(kLookUpDescriptors)) {
            return shown + " cannot be looked up: " + strerror(lack);
        }
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
