#include "programs/zelctl/restore/source.h"

#include <algorithm>
#include <vector>

#include "ZEL/channel.h"
#include "programs/common/failure.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_settings.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using ZEL::PObject;

// The task with its password; without it when this user may not see passwords.
PObject AskForTask(const std::string& name) {
    PObject request = TaskRequest("task_show", name);
    request["secrets"] = 1;
    try {
        return AskDaemon(request)["task"];
    } catch (const Failure& failure) {
        if (failure.Status() != ZEL::RESULT_NO_PERMISSION) {
            throw;
        }
    }
    return AskDaemon(TaskRequest("task_show", name))["task"];
}

std::string OnlyShare(const std::string& task, const std::vector<std::string>& shares) {
    if (shares.size() == 1) {
        return shares.front();
    }
    std::string list;
    for (const std::string& share : shares) {
        list += (list.empty() ? "" : ", ") + Printable(share);
    }
    throw Failure(FailureKind::kUsage, "task '" + Printable(task) + "' has the shares " + list +
                                           ": say which one with --share");
}

}  // namespace

CopySource FindSource(const std::string& task, std::string share,
                      const ConnectionOptions& connection) {
    if (task.empty()) {
        if (share.empty()) {
            throw Failure(FailureKind::kUsage, "--share is missing: which share of the server?");
        }
        return {connection.ToSyncInfo(), share};
    }
    PObject map = AskForTask(task);
    const PObject& settings = map;
    const std::vector<std::string> shares = programs::TextsOf(settings["share_list"]);
    if (share.empty()) {
        share = OnlyShare(task, shares);
    } else if (std::find(shares.begin(), shares.end(), share) == shares.end()) {
        throw Failure(FailureKind::kUsage,
                      "task '" + Printable(task) + "' has no share '" + Printable(share) + "'");
    }
    if (settings["pswd"].asString().empty()) {
        map["pswd"] = programs::ReadPassword(
            connection.password_file, "Password of " + Printable(settings["user"].asString()) +
                                          " on " + Printable(programs::ServerOf(settings)) + ": ");
    }
    programs::TaskSettings read;
    read.SetMap(map);
    ZEL::SyncInfo info = read.Info().GetSyncInfo();
    info.SetMaxBandwidth(read.Limits().Now());
    return {info, share};
}

}  // namespace zelctl
