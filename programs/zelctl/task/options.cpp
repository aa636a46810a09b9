#include "programs/zelctl/task/options.h"

#include <algorithm>
#include <set>

#include "programs/common/text.h"
#include "programs/zelctl/server/connection.h"
#include "programs/zelctl/share/commands.h"

namespace zelctl {

namespace {

ExitCode SetShares(const std::vector<std::string>& shares, ZEL::TaskInfo& info) {
    std::set<std::string> seen;
    for (const std::string& share : shares) {
        if (!seen.insert(share).second) {
            return Fail(kUsage, "share '%s' is given twice", programs::Printable(share).c_str());
        }
    }
    const ExitCode checked = CheckShares(shares);
    if (checked == kOk) {
        info.SetShareList({shares.begin(), shares.end()});
    }
    return checked;
}

template <typename T>
void Set(const std::optional<T>& value, ZEL::SyncInfo& info, void (ZEL::SyncInfo::*setter)(T)) {
    if (value) {
        (info.*setter)(*value);
    }
}

}  // namespace

ExitCode TaskOptions::ApplyTo(ZEL::TaskInfo& info) const {
    if (!shares.empty()) {
        const ExitCode checked = SetShares(shares, info);
        if (checked != kOk) {
            return checked;
        }
    }
    ZEL::SyncInfo sync = info.GetSyncInfo();
    if (server) {
        if (server->empty()) {
            return Fail(kUsage, "--server: give the server's name or address");
        }
        SetServer(*server, sync);
    }
    if (user) {
        if (user->empty()) {
            return Fail(kUsage, "--user: give the account's name");
        }
        sync.SetUser(*user);
    }
    Set(ssh, sync, &ZEL::SyncInfo::SetSSH);
    Set(compress, sync, &ZEL::SyncInfo::SetCompression);
    Set(delta, sync, &ZEL::SyncInfo::SetBlockLevelSync);
    Set(ssh_port, sync, &ZEL::SyncInfo::SetSSHPort);
    Set(timeout, sync, &ZEL::SyncInfo::SetRsyncTimeout);
    Set(bandwidth_limit, sync, &ZEL::SyncInfo::SetMaxBandwidth);
    info.SetSyncInfo(sync);
    if (schedule.Any()) {
        const std::string fault = programs::ApplyWords(schedule, info.GetSchedule());
        if (!fault.empty()) {
            return Fail(kUsage, "%s", fault.c_str());
        }
    }
    return kOk;
}

ExitCode CheckTaskName(const std::string& name) {
    if (!programs::IsTaskName(name)) {
        return Fail(kUsage,
                    "'%s' cannot be a task's name: it has 1 to 128 bytes, without control "
                    "characters, quotes and brackets",
                    programs::Printable(name).c_str());
    }
    return kOk;
}

ExitCode CheckTask(const ZEL::TaskInfo& info) {
    return info.Validate() ? kOk
                           : Fail(kUsage,
                                  "task '%s' is not possible: 'zelctl -v' with the same command "
                                  "says why",
                                  programs::Printable(info.GetName()).c_str());
}

ZEL::PObject ToArray(const std::vector<std::string>& texts) {
    ZEL::PObject array;
    array.asArray().assign(texts.begin(), texts.end());
    return array;
}

}  // namespace zelctl
