#include "programs/zel_server/reading_commands.h"

#include <unistd.h>

#include <optional>
#include <sstream>

#include "programs/common/server_status.h"
#include "programs/zel_server/command_paths.h"
#include "programs/zel_server/copy_moves.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/past_tree.h"
#include "programs/zel_server/path_versions.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/storage.h"

namespace zel_server {

namespace {

using namespace programs;

// An answer has at most 16 MiB; one line of it less than this.
constexpr size_t kMaxAnswer = (size_t{16} << 20) - 4096;

// The share, if it is the account's and where it was set up. kDone, or why not.
int ReadOwnShare(const Request& request, const std::string& share, ShareState& state) {
    const ReadResult read = ReadShare(share, state);
    if (read == ReadResult::kMissing) {
        return kNoSuchShare;
    }
    if (read != ReadResult::kRead) {
        return kRegistryRead;
    }
    if (state.account != request.account) {
        return kOtherAccount;
    }
    const StorageState storage = CheckStorage(request.config, FolderAbove(state.path));
    return storage == StorageState::kReady || storage == StorageState::kReadOnly ? kDone : kStorage;
}

// The same for a command that holds the registry's lock for this moment alone.
int FindOwnShare(const Request& request, const std::string& share, ShareState& state) {
    const RegistryLock lock;
    if (!lock.Held() || !TakeOverOldModules()) {
        return kRegistryWrite;
    }
    CloseSilentModules();
    const int refusal = ReadOwnShare(request, share, state);
    return refusal == kDone && !SettleMoves(share, state.path) ? kServerFault : refusal;
}

// The path of a command, which may be missing: all of the share.
std::optional<std::string> PathOf(const Command& command) {
    const std::string* const path = command.Find("path");
    return path == nullptr ? std::string() : ParsePath(*path);
}

// What a command names: a share of the account's, and a path below it.
struct SharePart {
    std::string share;
    std::string path;
    ShareState state;
};

// kDone, or why not.
int FindPart(const Request& request, SharePart& part) {
    const std::string* const share = request.command.Find("shareName");
    auto path = PathOf(request.command);
    if (share == nullptr || !IsShareName(*share) || !path ||
        request.command.Find("outfile") == nullptr) {
        return kBadArgument;
    }
    part.share = *share;
    part.path = *std::move(path);
    return FindOwnShare(request, part.share, part.state);
}

Answer ModuleAnswer(const std::string& module) {
    return {kDone, "module=\"" + module + "\"\n"};
}

}  // namespace

Answer OpenShare(const Request& request) {
    const std::string* const share = request.command.Find("shareName");
    const std::string* const wanted = request.command.Find("access");
    if (share == nullptr || !IsShareName(*share) || wanted == nullptr ||
        (*wanted != "read" && *wanted != "compare") || request.command.Find("outfile") == nullptr) {
        return {kBadArgument, ""};
    }
    ShareState state;
    const int refusal = ReadOwnShare(request, *share, state);
    if (refusal != kDone) {
        return {refusal, ""};
    }
    if (access(state.path.c_str(), F_OK) != 0) {
        return {kNoSuchShare, ""};
    }
    const auto module = OpenForReading(request.config, *share, state, request.Client(),
                                       *wanted == "read" ? Access::kRead : Access::kCompare);
    return module ? ModuleAnswer(*module) : Answer{kServerFault, ""};
}

Answer OpenShareAt(const Request& request) {
    const std::string* const at = request.command.Find("at");
    const auto time = at == nullptr ? std::nullopt : ParseTimeText(*at);
    if (!time) {
        return {kBadArgument, ""};
    }
    SharePart part;
    const int refusal = FindPart(request, part);
    if (refusal != kDone) {
        return {refusal, ""};
    }
    const std::string module = NewModuleName();
    if (module.empty()) {
        return {kServerFault, ""};
    }
    const std::string tree = module.substr(1);
    base::UniqueFd made;  // until the module is open
    switch (
        MakePastTree(request.config, {part.share, part.state.path, part.path, *time}, tree, made)) {
        case PastTreeResult::kMade:
            break;
        case PastTreeResult::kNothing:
            return {kNothingThen, ""};
        case PastTreeResult::kNoBirthTimes:
            return {kNoBirthTimes, ""};
    }
    const RegistryLock lock;
    return lock.Held() && OpenPast(request.config, part.share, part.state, request.Client(), module,
                                   PastTreePath(FolderAbove(part.state.path), tree))
               ? ModuleAnswer(module)
               : Answer{kRegistryWrite, ""};
}

Answer CloseShareAt(const Request& request) {
    const std::string* const module = request.command.Find("module");
    if (module == nullptr) {
        return {kBadArgument, ""};
    }
    const RegistryLock lock;
    if (!lock.Held()) {
        return {kRegistryWrite, ""};
    }
    ClosePast(*module, request.account);
    return {kDone, ""};
}

Answer ListShareVersions(const Request& request) {
    SharePart part;
    const int refusal = FindPart(request, part);
    if (refusal != kDone) {
        return {refusal, ""};
    }
    std::string text;
    const bool all =
        VisitVersions(part.share, part.state.path, part.path, [&text](const PathVersion& version) {
            text += TimeText(version.until) + " " + std::to_string(version.files) + " " +
                    std::to_string(version.bytes) + " " +
                    (version.since ? TimeText(*version.since) : "-") + "\n";
            return text.size() < kMaxAnswer;
        });
    return {kDone, text + (all ? "" : "more\n")};
}

}  // namespace zel_server
