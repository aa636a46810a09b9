#include "programs/zelctl/task/options.h"

#include <algorithm>
#include <set>

#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zelctl/server/connection.h"
#include "programs/zelctl/share/commands.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;

void SetShares(const std::vector<std::string>& shares, ZEL::TaskInfo& info) {
    std::set<std::string> seen;
    for (const std::string& share : shares) {
        if (!seen.insert(share).second) {
            throw Failure(FailureKind::kUsage,
                          "share '" + programs::Printable(share) + "' is given twice");
        }
    }
    CheckShares(shares);
    info.SetShareList({shares.begin(), shares.end()});
}

template <typename T>
void Set(const std::optional<T>& value, ZEL::SyncInfo& info, void (ZEL::SyncInfo::*setter)(T)) {
    if (value) {
        (info.*setter)(*value);
    }
}

}  // namespace

void TaskOptions::ApplyTo(ZEL::TaskInfo& info) const {
    if (!shares.empty()) {
        SetShares(shares, info);
    }
    ZEL::SyncInfo sync = info.GetSyncInfo();
    if (server) {
        if (server->empty()) {
            throw Failure(FailureKind::kUsage, "--server: give the server's name or address");
        }
        SetServer(*server, sync);
    }
    if (user) {
        if (user->empty()) {
            throw Failure(FailureKind::kUsage, "--user: give the account's name");
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
            throw Failure(FailureKind::kUsage, fault);
        }
    }
}

void CheckTaskName(const std::string& name) {
    if (!programs::IsTaskName(name)) {
        throw Failure(FailureKind::kUsage,
                      "'" + programs::Printable(name) +
                          "' cannot be a task's name: it has 1 to 128 bytes, without control "
                          "characters, quotes and brackets");
    }
}

void CheckTask(const ZEL::TaskInfo& info) {
    if (!info.Validate()) {
        throw Failure(FailureKind::kUsage, "task '" + programs::Printable(info.GetName()) +
                                               "' is not possible: 'zelctl -v' with the same "
                                               "command says why");
    }
}

ZEL::PObject ToArray(const std::vector<std::string>& texts) {
    ZEL::PObject array;
    array.asArray().assign(texts.begin(), texts.end());
    return array;
}

}  // namespace zelctl
