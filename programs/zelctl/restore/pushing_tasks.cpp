#include "programs/zelctl/restore/pushing_tasks.h"

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <thread>

#include "ZEL/sync_obj.h"
#include "ZEL/zel.h"
#include "programs/common/failure.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/share/commands.h"

namespace zelctl {

namespace {

namespace fs = std::filesystem;
using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using ZEL::PObject;

// How long a run may take to end once it is cancelled.
constexpr std::chrono::seconds kEndOfRun(20);

bool IsBelow(const fs::path& path, const fs::path& folder) {
    const auto [rest, in_path] =
        std::mismatch(folder.begin(), folder.end(), path.begin(), path.end());
    return rest == folder.end();
}

// Resolved as far as it exists.
fs::path Resolved(const fs::path& path) {
    std::error_code error;
    fs::path resolved = fs::weakly_canonical(path, error);
    if (error) {
        resolved = fs::absolute(path, error).lexically_normal();
    }
    // "/a/" has an empty last name.
    return resolved.has_filename() || resolved == resolved.root_path() ? resolved
                                                                       : resolved.parent_path();
}

bool PushesFrom(const PObject& task, const fs::path& folder) {
    for (const std::string& share : programs::TextsOf(task["share_list"])) {
        ZEL::ShareInfo facts;
        if (ZEL::GetShareInfo(share, facts) == 0) {
            const fs::path pushed = Resolved(facts.GetModulePath());
            if (IsBelow(folder, pushed) || IsBelow(pushed, folder)) {
                return true;
            }
        }
    }
    return false;
}

void EndRun(const std::string& name) {
    AskDaemon(TaskRequest("task_cancel", name));
    const auto until = std::chrono::steady_clock::now() + kEndOfRun;
    while (AskDaemon(TaskRequest("task_show", name))["task"]["status"].asInt32() ==
           ZEL::TASK_STATUS_RUNNING) {
        if (Interrupted() || std::chrono::steady_clock::now() > until) {
            throw Failure(FailureKind::kFailed,
                          "the run of task '" + Printable(name) +
                              "', which pushes this folder, does not end: nothing was restored");
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
}

}  // namespace

void PauseTasksPushing(const std::string& folder) {
    PObject request;
    request["command"] = "task_list";
    request["brief"] = 1;
    const auto reply = TryToAskDaemon(request);
    if (!reply) {
        return;  // nobody pushes
    }
    const fs::path restored = Resolved(folder);
    for (const PObject& task : (*reply)["tasks"].asArray()) {
        const std::string name = task["name"].asString();
        const int status = task["status"].asInt32();
        if (!PushesFrom(task, restored) || status == ZEL::TASK_STATUS_PAUSED) {
            continue;
        }
        AskDaemon(TaskRequest("task_pause", name));
        if (status == ZEL::TASK_STATUS_RUNNING) {
            EndRun(name);
        }
        printf(
            "Task '%s' pushes this folder and is paused now: look at what has come back, then "
            "say 'zelctl task resume %s'.\n",
            Printable(name).c_str(), Printable(name).c_str());
        fflush(stdout);
    }
}

}  // namespace zelctl
