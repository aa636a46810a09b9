#include "ZEL/sync_obj.h"

#include "ZEL/log.h"
#include "ZEL/zel.h"

namespace ZEL {

namespace {

constexpr uint32_t kMaxPort = 65535;
constexpr uint32_t kMinRsyncTimeout = 600;  // seconds; a server's disks may need minutes to spin up
constexpr uint32_t kMaxRsyncTimeout = 86400;  // seconds

}  // namespace

bool SyncInfo::Validate() const {
    if (server_ip_.empty() && server_name_.empty()) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Empty server ip and name\n",
                       __LINE__);
        return false;
    }
    if (user_.empty()) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Empty user name\n", __LINE__);
        return false;
    }
    if (ssh_port_ > kMaxPort) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid SSH port '%u'\n",
                       __LINE__, ssh_port_);
        return false;
    }
    if (rsync_timeout_ < kMinRsyncTimeout || rsync_timeout_ > kMaxRsyncTimeout) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/sync_obj(%d): Invalid rsync timeout '%u'\n", __LINE__,
                       rsync_timeout_);
        return false;
    }
    return true;
}

bool TaskInfo::Validate() const {
    if (!sync_info_.Validate() || !schedule_.Validate()) {
        return false;
    }
    // The next two messages have no line end: programs that parse the log rely on it.
    if (name_.empty()) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Empty task name", __LINE__);
        return false;
    }
    if (share_list_.empty()) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Empty share list", __LINE__);
        return false;
    }
    for (const std::string& share : share_list_) {
        bool valid = false;
        if (IsValidShare(share, valid) < 0 || !valid) {
            Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Share '%s' is not valid\n",
                           __LINE__, share.c_str());
            return false;
        }
    }
    return true;
}

void Event::SetRelativePath(const std::string& path) {
    relative_path_ = !path.empty() && path.front() == '/' ? path : "/" + path;
}

}  // namespace ZEL
