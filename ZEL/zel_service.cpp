// The service's daemon and scratch files: the third part of zel.h.
#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "base/own_folder.h"
#include "tarq/core.h"
#include "tarq/root_path.h"
#include "tarq/systemd.h"

namespace ZEL {

namespace {

constexpr char kDaemonUnit[] = "zel_daemon";
constexpr char kTempFolder[] = "/tmp/ZEL";
constexpr char kTempTemplate[] = "/tmp/ZEL/temp.XXXXXX";

}  // namespace

bool IsDaemonRunning() {
    return TARQSystemdActiveStatusGet(kDaemonUnit) == 1;
}

int StartDaemon() {
    if (TARQSystemdStart(kDaemonUnit) != 0) {
        return 0;
    }
    const int error = KAPICErrGet();
    if (error == TARQ_ERR_SERVICE_BUSY) {
        return 0;  // it is on its way up, which is what was asked for
    }
    Logger::LogMsg(Logger::LEVEL_ERROR,
                   "[ERROR] ZEL/zel(%d): Fail to start daemon, tarqerr=[0x%04X]\n", __LINE__,
                   static_cast<unsigned int>(error));
    return -1;
}

int StopDaemon() {
    if (TARQSystemdStop(kDaemonUnit) != 0) {
        return 0;
    }
    Logger::LogMsg(Logger::LEVEL_ERROR,
                   "[ERROR] ZEL/zel(%d): Fail to stop daemon, tarqerr=[0x%04X]\n", __LINE__,
                   static_cast<unsigned int>(KAPICErrGet()));
    return -1;
}

bool IsPathExist(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

std::string GetTempFile() {
    // Anybody may have made that folder, and would own what is put there.
    if (!base::IsOwnFolder(TARQ::RootPath(kTempFolder))) {
        return "";
    }
    std::string path = TARQ::RootPath(kTempTemplate);
    const int fd = mkostemp64(path.data(), O_CLOEXEC);
    if (fd < 0) {
        return "";
    }
    close(fd);
    return path;
}

void PutTempFile(const std::string& path) {
    if (!path.empty() && unlink(path.c_str()) != 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/zel(%d): Fail to unlink temp file '%s' [%d]\n", __LINE__,
                       path.c_str(), errno);
    }
}

}  // namespace ZEL
