#include "programs/zel_server/command_handler.h"

#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <new>
#include <vector>

#include "ZEL/is_syncedshare.h"
#include "ZEL/rsyncer.h"
#include "base/random_digits.h"
#include "base/text.h"
#include "programs/common/server_status.h"
#include "programs/common/text.h"
#include "programs/zel_server/admission.h"
#include "programs/zel_server/clients.h"
#include "programs/zel_server/connections.h"
#include "programs/zel_server/deposit_commands.h"
#include "programs/zel_server/move_command.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/reading_commands.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/request.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/share_push.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/tasks.h"
#include "tarq/owners.h"

namespace zel_server {

namespace {

using namespace programs;

constexpr char kProtocolVersion[] = "1\n";

std::optional<bool> YesNo(const std::string* value) {
    if (value == nullptr || (*value != "yes" && *value != "no")) {
        return std::nullopt;
    }
    return *value == "yes";
}

Answer Pair(const Request& request, const std::string& server_name, bool dry_run) {
    return {dry_run ? PairingRefusal(request.Client(), request.account)
                    : RecordPairing(request.Client(), request.account, server_name),
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
    return Pair(request, *server_name, *dry_run);
}

// Refuses in advance what the start of a push would refuse.
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
    if (shares.size() > kMaxAccountShares) {
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
    const Refusal refusal = RefusalOf(shares, request.Client(), request.account);
    std::string refused;
    for (const std::string& share : refusal.shares) {
        refused += (refused.empty() ? "" : ":") + share;
    }
    if (refusal.status != kDone) {
        // One status for all cases, whoever owns the share.
        return {refusal.status == kOtherAccount ? kConflicts : refusal.status,
                refused.empty() ? "" : refused + "\n"};
    }
    return Pair(request, *server_name, *dry_run);
}

Answer UpdateTaskStatus(const Request& request) {
    const std::string* const task = request.command.Find("taskName");
    if (task == nullptr || !programs::IsTaskName(*task)) {
        return {kBadArgument, ""};
    }
    const int paired = RequirePaired(request);
    if (paired != kDone) {
        return {paired, ""};
    }
    // The share that the task is pushing now. Other shares of the client are not kept open, in case
    // an earlier run died and left them open.
    if (const std::string* const share = request.command.Find("shareName");
        share != nullptr && IsShareName(*share)) {
        KeepOpen(*share, request.Client(), request.account);
    }
    return {RecordTask(request.Client(), request.account, *task, true), ""};
}

Answer FinishSync(const Request& request) {
    const std::string* const type = request.command.Find("finishType");
    const std::string* const name = request.command.Find("name");
    if (type == nullptr || name == nullptr) {
        return {kBadArgument, ""};
    }
    const int paired = RequirePaired(request);
    if (paired != kDone) {
        return {paired, ""};
    }
    if (*type == "share" || *type == "abort") {
        return FinishShare(request, *name, *type == "share");
    }
    if (*type == "task" && programs::IsTaskName(*name)) {
        return {RecordTask(request.Client(), request.account, *name, false), ""};
    }
    return {kBadArgument, ""};
}

constexpr char kStartCommand[] = "ZEL_SyncStart";

struct CommandEntry {
    const char* name;
    Answer (*execute)(const Request&);
    bool changes;                              // needs the registry's lock
    void (*before)(const Request&) = nullptr;  // called without it
};
constexpr CommandEntry kCommands[] = {
    {"ZEL_GetProtocolVer", TellProtocolVersion, false},
    {"ZEL_Pairing", PairSingleSource, true},
    {"ZEL_PairingMultiSrc", PairMultiSource, true},
    {kStartCommand, StartSync, true, AwaitEarlierPushes},
    {"ZEL_UpdateTaskStatus", UpdateTaskStatus, true},
    {"ZEL_SyncFinish", FinishSync, true},
    {"ZEL_Move", MoveInShare, true},
    {"ZEL_OpenShare", OpenShare, true},
    {"ZEL_DepositConfig", DepositConfig, true},
    {"ZEL_ListDeposits", ListDeposits, false},
    {"ZEL_FetchDeposit", FetchDeposit, false},
    // These take the lock for a moment alone.
    {"ZEL_OpenShareAt", OpenShareAt, false},
    {"ZEL_CloseShareAt", CloseShareAt, false},
    {"ZEL_ListVersions", ListShareVersions, false},
};

std::string Environment(const char* name) {
    const char* const value = getenv(name);
    return value != nullptr ? value : "";
}

// Reads one byte more than a command may have, so that a longer one is detected.
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

// Commands that change something have the registry to themselves. `before`: called without that.
template <typename Step>
Answer ExecuteLocked(const Request& request, Step step, void (*before)(const Request&)) {
    if (before != nullptr) {
        before(request);
    }
    const RegistryLock lock;
    if (!lock.Held() || !TakeOverOldModules()) {
        return {kRegistryWrite, ""};
    }
    CloseSilentModules();
    return step(request);
}

int SwitchRefusal() {
    const Switch on = ReadSwitch();
    return on == Switch::kOn ? kDone : on == Switch::kOff ? kSwitchedOff : kRegistryRead;
}

// Every failure becomes a status for the client. `execute`: with the configuration and the command.
template <typename Step>
Answer AnswerTo(const std::string& text, const std::string& account, Step execute) {
    try {
        const std::optional<ServerConfig> config = LoadServerConfig();
        const std::optional<Command> command = ParseCommand(text);
        return !config    ? Answer{kStorage, ""}
               : !command ? Answer{kBadArgument, ""}
                          : execute(*config, *command);
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
    const int refusal = SwitchRefusal();
    if (refusal != kDone) {
        return {refusal, ""};
    }
    for (const CommandEntry& entry : kCommands) {
        if (command.name == entry.name) {
            const Request request{config, account, command};
            return entry.changes ? ExecuteLocked(request, entry.execute, entry.before)
                                 : entry.execute(request);
        }
    }
    return {kUnknownCommand, ""};
}

int BeginPush() {
    const std::string text = ReadStandardInput();
    const std::string account = Environment("RSYNC_USER_NAME");
    const std::string connection = Environment("RSYNC_PID");
    if (!IsAccountName(account) || !base::ParseNumber(connection, INT32_MAX)) {
        return 1;
    }
    // Left by a process of the same number.
    if (unlink(LinkOfPush(connection).c_str()) != 0 && errno != ENOENT) {
        return 1;
    }
    if (AdmitConnection() != Admission::kAdmitted) {
        return 1;
    }
    const auto begin = [&](const ServerConfig& config, const Command& command) -> Answer {
        const int refusal = command.name == kStartCommand ? SwitchRefusal() : kUnknownCommand;
        if (refusal != kDone) {
            return {refusal, ""};
        }
        return ExecuteLocked(
            {config, account, command},
            [&](const Request& request) -> Answer {
                return {BeginInConnection(request, connection), ""};
            },
            AwaitEarlierPushes);
    };
    return AnswerTo(text, account, begin).status == kDone ? 0 : 1;
}

int HandleCommand() {
    const std::string text = ReadStandardInput();
    const std::string account = Environment("RSYNC_USER_NAME");
    const std::string connection = Environment("RSYNC_PID");
    const std::optional<std::string> session = ParseSession(text);
    if (!session || !IsAccountName(account) || !base::ParseNumber(connection, INT32_MAX)) {
        // The daemon shows this to the client.
        puts("This module takes commands of the synchronisation service only.");
        return 1;
    }
    const Admission admission = AdmitConnection();
    if (admission == Admission::kNotServed) {
        return 1;
    }
    const auto execute = [&account](const ServerConfig& config, const Command& command) {
        return Execute(config, account, command);
    };
    const Answer answer = admission == Admission::kTooMany ? Answer{kTooManyConnections, ""}
                                                           : AnswerTo(text, account, execute);
    if (!PrepareAnswers(account) || !WriteAnswer(account, *session, connection, answer)) {
        printf("The server cannot write its answer: %s\n", strerror(errno));
        return 1;
    }
    return 0;
}

}  // namespace zel_server
