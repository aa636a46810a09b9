#include "programs/zel_server/share_push.h"

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <optional>
#include <thread>
#include <vector>

#include "base/percent.h"
#include "base/random_digits.h"
#include "base/text.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/admission.h"
#include "programs/zel_server/clients.h"
#include "programs/zel_server/command_paths.h"
#include "programs/zel_server/move_command.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/partial_store.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_copy.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/storage.h"

namespace zel_server {

namespace {

using namespace programs;

// A client waits for a minute for the answer to a command.
constexpr std::chrono::seconds kLongestWait(20);
constexpr std::chrono::milliseconds kPause(5);

// The parameters of a start command. Nothing when a value is missing or invalid.
struct StartRequest {
    std::string share;
    std::string volume;
    bool encrypted = false;
    std::string push;                  // the client's mark of this push; empty: it gives none
    std::vector<std::string> sending;  // paths of files that broken pushes may have been sending
};

std::optional<StartRequest> ParseStart(const Command& command) {
    const std::string* const share = command.Find("shareName");
    const std::string* const volume = command.Find("volumeName");
    if (share == nullptr || volume == nullptr || !IsShareName(*share) ||
        !IsHarmlessVolumeName(*volume)) {
        return std::nullopt;
    }
    for (const char* key : {"isEncrypt", "isAutomount", "isEnableACL", "isWinShare"}) {
        const std::string* const value = command.Find(key);
        if (value != nullptr && *value != "0" && *value != "1") {
            return std::nullopt;
        }
    }
    const std::string* const key_length = command.Find("lenEncKey");
    if (key_length != nullptr && !base::ParseNumber(*key_length, 65536)) {
        return std::nullopt;
    }
    const std::string* const encrypted = command.Find("isEncrypt");
    const std::string* const push = command.Find("push");
    if (push != nullptr && !base::AreRandomDigits(*push)) {
        return std::nullopt;
    }
    const auto sending = ParsePaths(command.Find("sending"));
    if (!sending) {
        return std::nullopt;
    }
    return StartRequest{*share, *volume, encrypted != nullptr && *encrypted == "1",
                        push != nullptr ? *push : "", *sending};
}

// The client has seen the end of a push in one connection before the server has recorded it, if it
// knows of a later state of the copy than there is; or goes on with that very push.
bool KnowsOfEnd(const Request& request, const StartRequest& start) {
    const auto running = FindPushInto(start.share);
    if (!running || running->client != request.Client() || running->account != request.account) {
        return false;
    }
    const CopyState copy = RecordedCopy(start.share);
    return (!start.push.empty() && start.push == running->mark) ||
           KnowsLater(copy, request.command);
}

/// A start that may be taken, and the share as it is before.
struct Start {
    StartRequest asked;
    ShareState state;
    bool is_known = false;  // the registry tells of the share
    bool stays = false;     // and its copy stays where it is
    CopyState copy = {};    // as recorded
};

// What every start is asked. Changes nothing.
int Judge(const Request& request, Start& start) {
    const std::optional<StartRequest> asked = ParseStart(request.command);
    if (!asked) {
        return kBadArgument;
    }
    start.asked = *asked;
    const std::string* const told_account = request.command.Find("connAccount");
    if (told_account != nullptr && *told_account != request.account) {
        return kOtherAccount;
    }
    if (asked->encrypted && !request.config.encryption) {
        return kNoEncryption;
    }
    // Ownership is checked first: otherwise a client that is not paired would be told to pair, only
    // to be refused after that.
    const int share = RefusalOf({asked->share}, request.Client(), request.account).status;
    const int refusal = share != kDone ? share : RequirePaired(request);
    if (refusal != kDone) {
        return refusal;
    }
    ShareState& state = start.state;
    start.is_known = ReadShare(asked->share, state) == ReadResult::kRead;
    state.module = asked->encrypted ? "@" + asked->share + "@" : asked->share;
    // A share stays where its copy is, whatever volume the client now names.
    start.stays =
        !state.path.empty() && state.path.substr(state.path.rfind('/') + 1) == state.module;
    if (!start.stays) {
        state.path = StorageFor(request.config, asked->volume) + "/" + state.module;
    }
    if (CheckStorage(request.config, FolderAbove(state.path)) != StorageState::kReady) {
        return kStorage;
    }
    start.copy = RecordedCopy(asked->share);
    return kDone;
}

// Notes that the client's push has begun.
bool Note(const Request& request, Start& start) {
    start.copy.push = start.asked.push;
    start.state.running_id = request.Client();
    start.state.account = request.account;
    start.state.last_result.clear();
    return WriteShare(start.asked.share, start.state) &&
           WriteShareRecord(start.asked.share, start.state, start.copy);
}

// Closed first: if a later step fails, nobody can write into it any more.
bool End(const std::string& share, const ShareState& state, bool completed) {
    CloseShare(share);
    if (!EndPush(share, state, completed)) {
        return false;
    }
    CopyState copy = RecordedCopy(share);
    if (completed && !copy.identity.empty()) {
        ++copy.generation;
        if (!WriteShareRecord(share, state, copy)) {
            return false;
        }
    }
    if (completed) {
        RemovePartials(share, state.path);
    }
    return true;
}

// Whether the copy is to the letter as the client says: this one, so far, and last touched by the
// push that the client names.
bool IsAsExpected(const CopyState& copy, const Command& command) {
    const std::string* const identity = command.Find("expectedCopy");
    const std::string* const generation = command.Find("expectedGeneration");
    const std::string* const push = command.Find("expectedPush");
    return identity != nullptr && generation != nullptr && push != nullptr &&
           !copy.identity.empty() && !copy.push.empty() && *identity == copy.identity &&
           *generation == std::to_string(copy.generation) && *push == copy.push;
}

}  // namespace

int RequirePaired(const Request& request) {
    switch (IsPaired(request.Client(), request.account)) {
        case Paired::kYes:
            return kDone;
        case Paired::kNo:
            return kNotPaired;
        default:
            return kRegistryRead;
    }
}

void AwaitEarlierPushes(const Request& request) {
    const std::optional<StartRequest> start = ParseStart(request.command);
    if (!start) {
        return;
    }
    const auto limit = std::chrono::steady_clock::now() + kLongestWait;
    while (KnowsOfEnd(request, *start) && std::chrono::steady_clock::now() < limit) {
        std::this_thread::sleep_for(kPause);
    }
    if (start->sending.empty()) {
        return;
    }
    ShareState state;
    {
        const RegistryLock lock;
        if (!lock.Held() ||
            RefusalOf({start->share}, request.Client(), request.account).status != kDone ||
            ReadShare(start->share, state) != ReadResult::kRead || state.path.empty()) {
            return;
        }
    }
    AwaitBrokenRuns(start->share, state.path, start->sending);
}

Answer StartSync(const Request& request) {
    Start start;
    const int refusal = Judge(request, start);
    if (refusal != kDone) {
        return {refusal, ""};
    }
    const std::string& share = start.asked.share;
    const std::string& path = start.state.path;
    switch (TakeCopy(request.config, share, path, start.is_known, start.copy)) {
        case CopyFound::kReady:
            break;
        case CopyFound::kNobodys:
            return {kNobodysCopy, ""};
        case CopyFound::kFailed:
            return {kStorage, ""};
    }
    std::string told = request.command.Find("outfile") != nullptr ? CopyAnswer(start.copy) : "";
    if (HasGoneOnWithout(start.copy, request.command)) {
        return {kCopyWentOn, told};
    }
    if (!Note(request, start)) {
        return {kRegistryWrite, ""};
    }
    if (!OpenForWriting(request.config, share, start.state)) {
        return {kStorage, ""};
    }
    const std::string partial = OfferPartial(share, path, start.asked.sending);
    if (!told.empty() && !partial.empty()) {
        told += "partial=\"" + base::PercentEncoded(partial, "/.-_") + "\"\n";
    }
    return {kDone, told};
}

Answer FinishShare(const Request& request, const std::string& share, bool completed) {
    if (!IsShareName(share)) {
        return {kBadArgument, ""};
    }
    ShareState state;
    const ReadResult read = ReadShare(share, state);
    if (read == ReadResult::kFailed || read == ReadResult::kDamaged) {
        return {kRegistryRead, ""};
    }
    // One in a connection ends with that, and in no other way.
    if (state.running_id != request.Client() || state.account != request.account ||
        FindPushInto(share)) {
        return {kNotRunning, ""};
    }
    return {End(share, state, completed) ? kDone : kRegistryWrite, ""};
}

int BeginInConnection(const Request& request, const std::string& process) {
    Start start;
    const int refusal = Judge(request, start);
    if (refusal != kDone) {
        return refusal;
    }
    const StartRequest& asked = start.asked;
    const std::optional<Moves> moves = ParseMoves(request.command);
    if (!moves) {
        return kBadArgument;
    }
    // The client goes another way then, and learns there what there is to know.
    if (!start.is_known || !start.stays || asked.encrypted || asked.push.empty() ||
        !asked.sending.empty() || !start.state.running_id.empty() || IsBeingPushed(asked.share) ||
        !IsAsExpected(start.copy, request.command) ||
        LookAtCopy(start.copy, start.state.path) != CopyFolder::kSame ||
        !KeepsAttributes(start.state.path)) {
        return kConflicts;
    }
    if (!Note(request, start)) {
        return kRegistryWrite;
    }
    // What the client sends is what is left to do when all of them are made.
    const std::vector<bool> made = MakeMovesQuietly(asked.share, start.state.path, *moves);
    if (std::find(made.begin(), made.end(), false) != made.end()) {
        End(asked.share, start.state, false);
        return kConflicts;
    }
    if (!OpenForConnection(request.config, asked.share, start.state, process, asked.push)) {
        unlink(LinkOfPush(process).c_str());
        End(asked.share, start.state, false);
        return kStorage;
    }
    return kDone;
}

bool EndInConnection(const OpenModule& push, const std::string& exit_status, bool wrote) {
    ShareState state;
    if (ReadShare(push.share, state) != ReadResult::kRead || state.running_id != push.client ||
        state.account != push.account) {
        CloseShare(push.share);
        return true;
    }
    state.last_result = exit_status;
    const bool completed =
        exit_status == "0" && wrote && RecordedCopy(push.share).push == push.mark;
    return End(push.share, state, completed);
}

}  // namespace zel_server
