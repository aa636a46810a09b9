#include "programs/zelctl/share/commands.h"

#include <algorithm>
#include <filesystem>
#include <set>

#include "programs/common/failure.h"
#include "programs/common/host.h"
#include "programs/common/share_notes.h"
#include "programs/common/table.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/prepare.h"
#include "programs/zelctl/doctor/checks.h"
#include "programs/zelctl/share/confirm.h"
#include "tarq/owners.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using TARQ::ShareOwner;

ShareOwner GetShare(const std::string& name) {
    TARQShare share = nullptr;
    const int found = TARQShareGet(name.c_str(), &share);
    ShareOwner owner(share);
    return found < 0 ? nullptr : std::move(owner);
}

std::string LastError() {
    return KAPICErrText(KAPICErrGet());
}

// The tasks that send the share; empty when the daemon cannot be asked.
std::set<std::string> TasksWith(const std::string& share) {
    ZEL::PObject request;
    request["command"] = "task_list";
    request["brief"] = 1;
    std::set<std::string> names;
    if (std::optional<ZEL::PObject> reply = TryToAskDaemon(request)) {
        for (const ZEL::PObject& task : (*reply)["tasks"].asArray()) {
            const ZEL::PObject::Array& shares = task["share_list"].asArray();
            if (std::any_of(shares.begin(), shares.end(),
                            [&](const ZEL::PObject& used) { return used.asString() == share; })) {
                names.insert(task["name"].asString());
            }
        }
    }
    return names;
}

}  // namespace

void AddShare(const std::string& name, const std::string& path, bool acl, bool windows) {
    PrepareHost();
    std::error_code error;
    const std::string absolute = std::filesystem::absolute(path, error).lexically_normal();
    unsigned int flags = 0;
    if (acl) {
        flags |= TARQ_SHARE_ACL;
    }
    if (windows) {
        flags |= TARQ_SHARE_WINDOWS;
    }
    const std::string unseen = DaemonsViewOf(absolute);
    const std::string shown = "'" + Printable(name) + "' at " + Printable(absolute);
    if (!unseen.empty()) {
        throw Failure(FailureKind::kLocal, "cannot add " + shown + ": " + unseen);
    }
    if (TARQShareAdd(name.c_str(), absolute.c_str(), flags) < 0) {
        throw Failure(FailureKind::kLocal,
                      KAPICErrGet() == TARQ_ERR_BAD_PARAMETER
                          ? shown +
                                " cannot be a share: a name has 1 to 80 bytes, none of / : \" or a "
                                "control character, and begins with neither a dot, an @ nor a "
                                "blank; the folder is not /"
                          : "cannot add " + shown + ": " + LastError());
    }
    printf("Share '%s' is %s\n", name.c_str(), absolute.c_str());
}

void RemoveShare(const std::string& name, bool force) {
    const std::set<std::string> users = force ? std::set<std::string>() : TasksWith(name);
    if (!users.empty()) {
        throw Failure(FailureKind::kLocal,
                      "share '" + Printable(name) + "' is sent by " +
                          Printable(TasksInWords(users)) +
                          ": take it out of there first ('zelctl task edit' or 'rm'), or give "
                          "--force");
    }
    if (TARQShareRemove(name.c_str()) < 0) {
        throw Failure(FailureKind::kLocal,
                      "cannot remove '" + Printable(name) + "': " + LastError());
    }
    programs::RemoveShareNotes(name);
    printf("Share '%s' is no longer in the catalogue; its files and its copy stay.\n",
           name.c_str());
}

std::vector<std::string> ShareNames() {
    const TARQ::ListOwner list(KAPICSzListAlloc(64));
    if (!list || TARQShareEnum(list.get()) < 0) {
        throw Failure(FailureKind::kLocal, "cannot read the share catalogue: " + LastError());
    }
    return TARQ::Entries(list);
}

void ListShares(bool as_json) {
    const std::vector<std::string> names = ShareNames();
    programs::Table table({"SHARE", "STATE", "FOLDER", "PROBLEM"});
    for (const std::string& name : names) {
        const ShareOwner share = GetShare(name);
        const bool known = share && share->path != nullptr;
        table.Add({name, share ? "ready" : "not ready", known ? share->path : "",
                   share ? "" : LastError()});
    }
    table.Print(as_json);
}

void CheckShares(const std::vector<std::string>& names) {
    for (const std::string& name : names) {
        const std::string problem = programs::ShareProblem(name);
        if (!problem.empty()) {
            throw Failure(FailureKind::kLocal, problem);
        }
    }
}

}  // namespace zelctl
