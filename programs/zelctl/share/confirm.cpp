#include "programs/zelctl/share/confirm.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <string_view>

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

ExitCode NotConfirmed(const std::string& name) {
    return Fail(kLocal, "cannot confirm share '%s': %s", Printable(name).c_str(),
                KAPICErrText(KAPICErrGet()));
}

ExitCode TellDaemon(const std::string& path) {
    const std::string unseen = DaemonsViewOf(path);
    if (!unseen.empty()) {
        return Fail(kLocal, "%s: %s", Printable(path).c_str(), unseen.c_str());
    }
    ZEL::PObject request;
    ZEL::PObject reply;
    std::string ignored;  // a daemon that does not run finds it when it starts
    request["command"] = "reload";
    AskDaemon(request, reply, &ignored);
    return kOk;
}

}  // namespace

std::string DaemonsViewOf(const std::string& path) {
    const std::optional<programs::SeenFolder> seen = programs::LookAtFolder(path);
    if (!seen) {
        return "";  // whoever uses the folder finds that, and says why
    }
    ZEL::PObject request;
    ZEL::PObject reply;
    request["command"] = "share_check";
    request["path"] = path;
    request["device"] = static_cast<unsigned long long>(seen->device);
    request["inode"] = static_cast<unsigned long long>(seen->inode);
    request["volume"] = seen->volume;
    std::string ignored;  // one that does not run, or may not be asked, is no witness
    AskDaemon(request, reply, &ignored);
    const std::string problem = reply["problem"].asString();
    return problem.empty()
               ? ""
               : "the daemon would not push this folder: " + Printable(problem) +
                     ". Its service has mounts of its own (look for PrivateTmp, ProtectHome, "
                     "BindPaths and the like in 'systemctl cat zel_daemon'), or its user may not "
                     "read the folder";
}

ExitCode ConfirmShare(const std::string& name, bool yes) {
    const TARQ::HashOwner recorded(KAPICSzHashAlloc(8));
    const TARQ::HashOwner now(KAPICSzHashAlloc(8));
    const int same =
        recorded && now ? TARQShareFactsGet(name.c_str(), recorded.get(), now.get()) : -1;
    if (same < 0) {
        return NotConfirmed(name);
    }
    const std::string path = ValueOf(now, "path");
    if (same == 1) {
        printf("Share '%s' is the folder that was recorded, %s: there is nothing to confirm.\n",
               Printable(name).c_str(), Printable(path).c_str());
        return TellDaemon(path);
    }
    printf("Share '%s' is %s:\n\n", Printable(name).c_str(), Printable(path).c_str());
    ShowFacts(recorded, now);
    printf("\nA push makes the server's copy equal to what is there now%s.%s\n",
           IsEmptyFolder(path) ? ", which is NOTHING: it deletes the whole copy" : "",
           ValueOf(recorded, "volume") == ValueOf(now, "volume") ? "" : " Is its disk mounted?");
    if (!yes && isatty(STDIN_FILENO) == 0) {
        return Fail(kUsage, "nobody to ask: say --yes when it is the right folder");
    }
    if (!yes && !AskPerson()) {
        return Fail(kCancelled, "share '%s' stays as it was recorded; nothing of it is pushed",
                    Printable(name).c_str());
    }
    if (TARQShareConfirm(name.c_str(), now.get()) < 0) {
        return NotConfirmed(name);
    }
    printf("Share '%s' is this folder from now on.\n", Printable(name).c_str());
    return TellDaemon(path);
}

}  // namespace zelctl
