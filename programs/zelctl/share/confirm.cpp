#include "programs/zelctl/share/confirm.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string_view>
#include <vector>

#include "programs/common/failure.h"
#include "programs/common/mounts_below.h"
#include "programs/common/seen_folder.h"
#include "programs/common/share_notes.h"
#include "programs/common/table.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/share/commands.h"
#include "tarq/core.h"
#include "tarq/owners.h"
#include "tarq/share.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;

/// A fact in the catalogue, and its name for people.
struct FactName {
    const char* key;
    const char* name;
};
constexpr FactName kFacts[] = {
    {"volume", "volume"},          {"volume_fs", "file system"},
    {"volume_uuid", "its UUID"},   {"folder_fs", "its kind"},
    {"folder_fsid", "its number"}, {"folder_inode", "the folder's number"},
    {"folder_birth", "made"},
};
constexpr std::string_view kBirth = "folder_birth";

std::string ValueOf(const TARQ::HashOwner& facts, const char* key) {
    const char* const value = KAPICSzHashGetValue(facts.get(), key);
    return value == nullptr ? "" : value;
}

// Converts a time in seconds, a point and nanoseconds into a readable one.
std::string Shown(const FactName& fact, const std::string& value) {
    if (fact.key != kBirth || value.empty()) {
        return value;
    }
    const size_t point = std::min(value.find('.'), value.size());
    return programs::HumanTime(strtoll(value.c_str(), nullptr, 10)) + value.substr(point);
}

void ShowFacts(const TARQ::HashOwner& recorded, const TARQ::HashOwner& now) {
    programs::Table table({"", "RECORDED", "NOW"});
    for (const FactName& fact : kFacts) {
        const std::string was = ValueOf(recorded, fact.key);
        const std::string is = ValueOf(now, fact.key);
        if (!was.empty() || !is.empty()) {
            table.Add({fact.name, Shown(fact, was), Shown(fact, is)});
        }
    }
    table.Print(false);
}

bool IsEmptyFolder(const std::string& path) {
    std::error_code error;
    return std::filesystem::is_empty(path, error) && !error;
}

Failure NotConfirmed(const std::string& name) {
    return {FailureKind::kLocal,
            "cannot confirm share '" + Printable(name) + "': " + KAPICErrText(KAPICErrGet())};
}

void RequireYes(bool yes, const char* question, const std::string& otherwise) {
    if (!yes && isatty(STDIN_FILENO) == 0) {
        throw Failure(FailureKind::kUsage, std::string("nobody to ask: say --yes when the answer "
                                                       "is yes: ") +
                                               question);
    }
    if (!yes && !programs::Confirm(question)) {
        throw Failure(FailureKind::kCancelled, otherwise);
    }
}

// When others have gone on with the share's copy, a person says which files are right. True when
// there was such a copy.
bool ConfirmCopy(const std::string& name, bool yes) {
    if (programs::ReadShareNotes(name).gone_on.empty()) {
        return false;
    }
    printf(
        "The server's copy of share '%s' was changed by another machine since this one last "
        "pushed\nit: by a clone of this machine, or before this machine was put back to an older "
        "state.\nA push makes the copy equal to what is here.\n",
        Printable(name).c_str());
    RequireYes(yes, "Are the files of this machine the ones to keep?",
               "the copy of share '" + Printable(name) + "' stays; nothing is pushed into it");
    programs::ChangeShareNotes(name, [](programs::ShareNotes& notes) {
        auto& copies = notes.copies;
        copies.erase(
            std::remove_if(copies.begin(), copies.end(),
                           [&](const auto& copy) { return copy.identity == notes.gone_on; }),
            copies.end());
        notes.gone_on.clear();
    });
    printf("The next push compares all of share '%s' and makes the copy like it.\n",
           Printable(name).c_str());
    return true;
}

// What was mounted below the share and is not there any more is gone when a person says so. True
// when there was something.
bool ConfirmMounts(const std::string& name, const std::string& path, bool yes) {
    const std::vector<std::string> away = programs::MissingMounts(name, path);
    if (away.empty()) {
        return false;
    }
    printf("Below share '%s' these were mounted before, and are not there now:\n",
           Printable(name).c_str());
    for (const std::string& mount : away) {
        printf("    %s\n", Printable(path + mount).c_str());
    }
    printf("The next push makes the server's copy of them equal to what is there now.\n");
    RequireYes(yes, "Are they gone for good?",
               "the copy of what was mounted below share '" + Printable(name) + "' stays");
    programs::ChangeShareNotes(name, [&](programs::ShareNotes& notes) {
        auto& mounts = notes.mounts;
        mounts.erase(std::remove_if(mounts.begin(), mounts.end(),
                                    [&](const std::string& mount) {
                                        return std::find(away.begin(), away.end(), mount) !=
                                               away.end();
                                    }),
                     mounts.end());
    });
    return true;
}

void TellDaemon(const std::string& path) {
    const std::string unseen = DaemonsViewOf(path);
    if (!unseen.empty()) {
        throw Failure(FailureKind::kLocal, Printable(path) + ": " + unseen);
    }
    ZEL::PObject request;
    request["command"] = "reload";
    TryToAskDaemon(request);  // a daemon that is not running reads it when it starts
}

}  // namespace

std::string DaemonsViewOf(const std::string& path) {
    const std::optional<programs::SeenFolder> seen = programs::LookAtFolder(path);
    if (!seen) {
        return "";  // reported by whoever uses the folder
    }
    ZEL::PObject request;
    request["command"] = "share_check";
    request["path"] = path;
    request["device"] = static_cast<unsigned long long>(seen->device);
    request["inode"] = static_cast<unsigned long long>(seen->inode);
    request["volume"] = seen->volume;
    // A daemon that is not running, or may not be asked, gives no information.
    const std::optional<ZEL::PObject> reply = TryToAskDaemon(request);
    const std::string problem = reply ? (*reply)["problem"].asString() : "";
    return problem.empty()
               ? ""
               : "the daemon would not push this folder: " + Printable(problem) +
                     ". Its service has mounts of its own (look for PrivateTmp, ProtectHome, "
                     "BindPaths and the like in 'systemctl cat zel_daemon'), or its user may not "
                     "read the folder";
}

void ConfirmShare(const std::string& name, bool yes) {
    const TARQ::HashOwner recorded(KAPICSzHashAlloc(8));
    const TARQ::HashOwner now(KAPICSzHashAlloc(8));
    const int same =
        recorded && now ? TARQShareFactsGet(name.c_str(), recorded.get(), now.get()) : -1;
    if (same < 0) {
        throw NotConfirmed(name);
    }
    const std::string path = ValueOf(now, "path");
    const bool of_copy = ConfirmCopy(name, yes);
    if (same == 1) {
        if (!ConfirmMounts(name, path, yes) && !of_copy) {
            printf("Share '%s' is the folder that was recorded, %s: there is nothing to confirm.\n",
                   Printable(name).c_str(), Printable(path).c_str());
        }
        TellDaemon(path);
        return;
    }
    printf("Share '%s' is %s:\n\n", Printable(name).c_str(), Printable(path).c_str());
    ShowFacts(recorded, now);
    printf("\nA push makes the server's copy equal to what is there now%s.%s\n",
           IsEmptyFolder(path) ? ", which is NOTHING: it deletes the whole copy" : "",
           ValueOf(recorded, "volume") == ValueOf(now, "volume") ? "" : " Is its disk mounted?");
    RequireYes(yes, "Is it the right folder?",
               "share '" + Printable(name) + "' stays as it was recorded; nothing of it is pushed");
    if (TARQShareConfirm(name.c_str(), now.get()) < 0) {
        throw NotConfirmed(name);
    }
    printf("Share '%s' is this folder from now on.\n", Printable(name).c_str());
    TellDaemon(path);
}

}  // namespace zelctl
