#include "programs/zelctl/share/confirm.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <string_view>

#include "programs/common/failure.h"
#include "programs/common/seen_folder.h"
#include "programs/common/table.h"
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

/// A fact of the catalogue, and how people call it.
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

// Seconds, a point and nanoseconds, as a person reads them.
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

bool AskPerson() {
    fputs("Is it the right folder? [y/N] ", stdout);
    fflush(stdout);
    std::string answer;
    std::getline(std::cin, answer);
    return answer == "y" || answer == "Y" || answer == "yes";
}

Failure NotConfirmed(const std::string& name) {
    return {FailureKind::kLocal,
            "cannot confirm share '" + Printable(name) + "': " + KAPICErrText(KAPICErrGet())};
}

void TellDaemon(const std::string& path) {
    const std::string unseen = DaemonsViewOf(path);
    if (!unseen.empty()) {
        throw Failure(FailureKind::kLocal, Printable(path) + ": " + unseen);
    }
    ZEL::PObject request;
    request["command"] = "reload";
    TryToAskDaemon(request);  // one that does not run finds it when it starts
}

}  // namespace

std::string DaemonsViewOf(const std::string& path) {
    const std::optional<programs::SeenFolder> seen = programs::LookAtFolder(path);
    if (!seen) {
        return "";  // whoever uses the folder finds that, and says why
    }
    ZEL::PObject request;
    request["command"] = "share_check";
    request["path"] = path;
    request["device"] = static_cast<unsigned long long>(seen->device);
    request["inode"] = static_cast<unsigned long long>(seen->inode);
    request["volume"] = seen->volume;
    // One that does not run, or may not be asked, is no witness.
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
    if (same == 1) {
        printf("Share '%s' is the folder that was recorded, %s: there is nothing to confirm.\n",
               Printable(name).c_str(), Printable(path).c_str());
        TellDaemon(path);
        return;
    }
    printf("Share '%s' is %s:\n\n", Printable(name).c_str(), Printable(path).c_str());
    ShowFacts(recorded, now);
    printf("\nA push makes the server's copy equal to what is there now%s.%s\n",
           IsEmptyFolder(path) ? ", which is NOTHING: it deletes the whole copy" : "",
           ValueOf(recorded, "volume") == ValueOf(now, "volume") ? "" : " Is its disk mounted?");
    if (!yes && isatty(STDIN_FILENO) == 0) {
        throw Failure(FailureKind::kUsage, "nobody to ask: say --yes when it is the right folder");
    }
    if (!yes && !AskPerson()) {
        throw Failure(
            FailureKind::kCancelled,
            "share '" + Printable(name) + "' stays as it was recorded; nothing of it is pushed");
    }
    if (TARQShareConfirm(name.c_str(), now.get()) < 0) {
        throw NotConfirmed(name);
    }
    printf("Share '%s' is this folder from now on.\n", Printable(name).c_str());
    TellDaemon(path);
}

}  // namespace zelctl
