#include "programs/zel_server/command_handler.h"

#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <exception>
#include <new>
#include <vector>

#include "ZEL/is_syncedshare.h"
#include "ZEL/rsyncer.h"
#include "base/text.h"
#include "programs/common/server_status.h"
#include "programs/common/text.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_module.h"
#include "tarq/owners.h"

namespace zel_server {

namespace {

using namespace programs;

constexpr char kProtocolVersion[] = "1\n";
constexpr size_t kMaxShares = 256;

struct Request {
    const ServerConfig& config;
    const std::string& account;
    const Command& command;

    const std::string& Client() const { return command.client_id; }
};

std::optional<bool> YesNo(const std::string* value) {
    if (value == nullptr || (*value != "yes" && *value != "no")) {
        return std::nullopt;
    }
    return *value == "yes";
}

// Why `account` of `client` may not have the share; kDone when it may.
int RefusalOf(const std::string& share, const std::string& client, const std::string& account) {
    ShareState state;
    const ReadResult read = ReadShare(share, state);
    if (read == ReadResult::kFailed || read == ReadResult::kDamaged) {
        return kRegistryRead;
    }
    if (!state.Owner().empty() && state.Owner() != client) {
        return kConflicts;
    }
    return state.account.empty() || state.account == account ? kDone : kOtherAccount;
}

// Asks the registry which of `shares` other clients push into now, under names of any letter case.
int AskRegistry(const std::vector<std::string>& shares, const std::string& client,
                std::list<std::string>& refused) {
    const TARQ::ListOwner asked(KAPICSzListAlloc(static_cast<int>(shares.size())));
    TARQ::ListOwner answer(KAPICSzListAlloc(static_cast<int>(shares.size())));
    if (!asked || !answer) {
        return kNoMemory;
    }
    for (const std::string& share : shares) {
        if (KAPICSzListPush(asked.get(), share.c_str()) != 0) {
            return kNoMemory;
        }
    }
    KAPICSzList list = answer.get();
    const int status = ZELCheckIfSharePaired(asked.get(), client.c_str(), &list);
    if (list != answer.get()) {
        static_cast<void>(answer.release());
        answer.reset(list);
    }
    for (int i = 0; i < KAPICSzListCount(list); ++i) {
        refused.emplace_back(KAPICSzListGet(list, i));
    }
    return status;
}

// A client that was paired alone keeps its pairing when the server begins to serve several.
int KeepSinglePairing(const std::string& new_client) {
    const int single = ZELServerIfOldClientPaired();
    if (single <= 0) {
        return single == 0 ? kDone : kRegistryRead;
    }
    Section pairing;
    if (ReadSection("PairedClientInfo", pairing) == ReadResult::kFailed) {
        return kRegistryRead;
    }
    return pairing["clientID"] == new_client || zel_svr_reset_pair() == 0 ? kDone : kRegistryWrite;
}

Answer RecordPairing(const Request& request, const std::string& server_name) {
    const int kept = KeepSinglePairing(request.Client());
    return {kept != kDone ? kept
                          : ZELServerUpdatePairInfo(request.Client().c_str(), server_name.c_str()),
            ""};
}

Answer TellProtocolVersion(const Request& request) {
    return request.command.Find("outfile") != nullptr ? Answer{kDone, kProtocolVersion}
                                                      : Answer{kBadArgument, ""};
}

Answer PairSingleSource(const Request& request) {
    const std::optional<bool> dry_run = YesNo(request.command.Find("dryRun"));
    const std::string* const server_name = request.command.Find("serverName");
    if (!dry_run || server_name == nullptr || !IsServerName(*server_name)) {
        return {kBadArgument, ""};
    }
    return *dry_run ? Answer{kDone, ""} : RecordPairing(request, *server_name);
}

Answer PairMultiSource(const Request& request) {
    const std::optional<bool> dry_run = YesNo(request.command.Find("dryRun"));
    const std::optional<bool> encryption =
        YesNo(request.command.Find("requireEncryptionShareSupport"));
    const std::string* const server_name = request.command.Find("serverName");
    const std::string* const joined = request.command.Find("syncShares");
    if (!dry_run || !encryption || joined == nullptr ||
        request.command.Find("outfile") == nullptr || server_name == nullptr ||
        !IsServerName(*server_name)) {
        return {kBadArgument, ""};
    }
    std::vector<std::string> shares;
    ZEL::SplitStringByChars(*joined, ":", shares);
    if (shares.size() > kMaxShares) {
        return {kBadArgument, ""};
    }
    for (const std::string& share : shares) {
        if (!IsShareName(share)) {
            return {kBadArgument, ""};
        }
    }
    if (*encryption && !request.config.encryption) {
        return {kNoEncryption, ""};
    }
    std::list<std::string> running;
    const int asked = AskRegistry(shares, request.Client(), running);
    if (asked != kDone && asked != kConflicts) {
        return {asked, ""};
    }
    std::string conflicts;
    for (const std::string& share : shares) {
        const int refusal = RefusalOf(share, request.Client(), request.account);
        if (refusal == kRegistryRead) {
            return {refusal, ""};
        }
        if (refusal != kDone || std::find(running.begin(), running.end(), share) != running.end()) {
            conflicts += (conflicts.empty() ? "" : ":") + share;
        }
    }
    if (!conflicts.empty()) {
        return {kConflicts, conflicts + "\n"};
    }
    return *dry_run ? Answer{kDone, ""} : RecordPairing(request, *server_name);
}

// What a start command says of the share. Nothing when a value is missing or not what it must be.
struct StartRequest {
    std::string share;
    std::string volume;
    bool encrypted = false;
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
    return StartRequest{*share, *volume, encrypted != nullptr && *encrypted == "1"};
}

// Another share whose name the rsync daemon, or a file system that folds case, would take for this
// one.
bool IsNameTaken(const std::string& share, const std::vector<std::string>& sections) {
    const std::string prefix = "SHARE_";
    for (const std::string& section : sections) {
        if (section.compare(0, prefix.size(), prefix) == 0) {
            const std::string other = section.substr(prefix.size());
            if (other != share && ModuleKey(other) == ModuleKey(share)) {
                return true;
            }
        }
    }
    return false;
}

int RequirePaired(const std::string& client) {
    switch (IsPaired(client)) {
        case Paired::kYes:
            return kDone;
        case Paired::kNo:
            return kNotPaired;
        default:
            return kRegistryRead;
    }
}

Answer StartSync(const Request& request) {
    const std::optional<StartRequest> start = ParseStart(request.command);
    if (!start) {
        return {kBadArgument, ""};
    }
    const std::string* const told_account = request.command.Find("connAccount");
    if (told_account != nullptr && *told_account != request.account) {
        return {kOtherAccount, ""};
    }
    if (start->encrypted && !request.config.encryption) {
        return {kNoEncryption, ""};
    }
    const int paired = RequirePaired(request.Client());
    const int refusal =
        paired != kDone ? paired : RefusalOf(start->share, request.Client(), request.account);
    if (refusal != kDone) {
        return {refusal, ""};
    }
    std::list<std::string> running;
    const int asked = AskRegistry({start->share}, request.Client(), running);
    if (asked != kDone) {
        return {asked, ""};
    }
    const auto sections = SectionNames();
    if (!sections) {
        return {kRegistryRead, ""};
    }
    if (IsNameTaken(start->share, *sections)) {
        return {kNameTaken, ""};
    }

    ShareState state;
    ReadShare(start->share, state);
    state.module = start->encrypted ? "@" + start->share + "@" : start->share;
    // A share stays where its copy is, whatever volume the client names today.
    if (state.path.empty() || state.path.substr(state.path.rfind('/') + 1) != state.module) {
        state.path = StorageFor(request.config, start->volume) + "/" + state.module;
    }
    if (CheckStorage(state.path.substr(0, state.path.rfind('/'))) != StorageState::kReady ||
        !MakeShareFolder(request.config, state.path)) {
        return {kStorage, ""};
    }
    state.running_id = request.Client();
    state.account = request.account;
    state.last_result.clear();
    if (!WriteShare(start->share, state)) {
        return {kRegistryWrite, ""};
    }
    return {WriteShareModule(request.config, start->share, state) ? kDone : kStorage, ""};
}

Answer UpdateTaskStatus(const Request& request) {
    const std::string* const task = request.command.Find("taskName");
    if (task == nullptr || !programs::IsTaskName(*task)) {
        return {kBadArgument, ""};
    }
    const int paired = RequirePaired(request.Client());
    if (paired != kDone) {
        return {paired, ""};
    }
    return {WriteTaskStatus(*task, std::to_string(time(nullptr))) ? kDone : kRegistryWrite, ""};
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
    if (state.running_id != request.Client() || state.account != request.account) {
        return {kNotRunning, ""};
    }
    if (completed) {
        state.complete_id = state.running_id;
        state.last_result = "0";
    } else if (state.last_result.empty()) {
        state.last_result = kEndedByClient;
    }
    state.last_time = std::to_string(time(nullptr));
    state.running_id.clear();
    return {WriteShare(share, state) ? kDone : kRegistryWrite, ""};
}

Answer FinishSync(const Request& request) {
    const std::string* const type = request.command.Find("finishType");
    const std::string* const name = request.command.Find("name");
    if (type == nullptr || name == nullptr) {
        return {kBadArgument, ""};
    }
    const int paired = RequirePaired(request.Client());
    if (paired != kDone) {
        return {paired, ""};
    }
    if (*type == "share" || *type == "abort") {
        return FinishShare(request, *name, *type == "share");
    }
    if (*type == "task" && programs::IsTaskName(*name)) {
        return {WriteTaskStatus(*name, "idle") ? kDone : kRegistryWrite, ""};
    }
    return {kBadArgument, ""};
}

struct CommandEntry {
    const char* name;
    Answer (*execute)(const Request&);
    bool changes;  // takes the registry's lock
};
constexpr CommandEntry kCommands[] = {
    {"ZEL_GetProtocolVer", TellProtocolVersion, false}, {"ZEL_Pairing", PairSingleSource, true},
    {"ZEL_PairingMultiSrc", PairMultiSource, true},     {"ZEL_SyncStart", StartSync, true},
    {"ZEL_UpdateTaskStatus", UpdateTaskStatus, true},   {"ZEL_SyncFinish", FinishSync, true},
};

std::string Environment(const char* name) {
    const char* const value = getenv(name);
    return value != nullptr ? value : "";
}

// One byte more than a command may have tells a command that is too long.
std::string ReadStandardInput() {
    std::string text(TARQ::Backup::kMaxCommandBytes + 1, '\0');
    size_t length = 0;
    while (length < text.size()) {
        const ssize_t count = read(STDIN_FILENO, text.data() + length, text.size() - length);
        if (count < 0 && errno == EINTR) {
            continue;
        }
        if (count <= 0) {
            break;
        }
        length += static_cast<size_t>(count);
    }
    text.resize(length);
    return text;
}

// Whatever goes wrong on the way, the client is told by a status.
Answer AnswerTo(const std::string& text, const std::string& account) {
    try {
        const std::optional<ServerConfig> config = LoadServerConfig();
        const std::optional<Command> command = ParseCommand(text);
        return !config    ? Answer{kStorage, ""}
               : !command ? Answer{kBadArgument, ""}
                          : Execute(*config, account, *command);
    } catch (const std::bad_alloc&) {
        return {kNoMemory, ""};
    } catch (const std::exception& error) {
        syslog(LOG_ERR, "zel_server: a command of account [%s] failed: %s", account.c_str(),
               error.what());
        return {kServerFault, ""};
    }
}

}  // namespace

Answer Execute(const ServerConfig& config, const std::string& account, const Command& command) {
    const Switch on = ReadSwitch();
    if (on != Switch::kOn) {
        return {on == Switch::kOff ? kSwitchedOff : kRegistryRead, ""};
    }
    for (const CommandEntry& entry : kCommands) {
        if (command.name == entry.name) {
            const Request request{config, account, command};
            if (!entry.changes) {
                return entry.execute(request);
            }
            const RegistryLock lock;
            return lock.Held() ? entry.execute(request) : Answer{kRegistryWrite, ""};
        }
    }
    return {kUnknownCommand, ""};
}

int HandleCommand() {
    const std::string text = ReadStandardInput();
    const std::string account = Environment("RSYNC_USER_NAME");
    const std::string connection = Environment("RSYNC_PID");
    const std::optional<std::string> session = ParseSession(text);
    if (!session || !IsAccountName(account) || !base::ParseNumber(connection, UINT32_MAX)) {
        // Shown to the client by the daemon.
        puts("This module takes commands of the synchronisation service only.");
        return 1;
    }
    const Answer answer = AnswerTo(text, account);
    if (!PrepareAnswers(account) || !WriteAnswer(account, *session, connection, answer)) {
        printf("The server cannot write its answer: %s\n", strerror(errno));
        return 1;
    }
    return 0;
}

}  // namespace zel_server
