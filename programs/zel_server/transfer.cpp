#include "programs/zel_server/transfer.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/background_priority.h"
#include "base/text.h"
#include "programs/zel_server/answers.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/partial_store.h"
#include "programs/zel_server/past_tree.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/share_push.h"
#include "programs/zel_server/space_debts.h"
#include "programs/zel_server/storage.h"
#include "programs/zel_server/transfer_arguments.h"
#include "programs/zel_server/version_keeper.h"
#include "programs/zel_server/versions_guard.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

constexpr size_t kMaxArguments = 64;
constexpr char kCannotWrite[] = "11";  // of rsync: an error in file I/O, as a full disk is

// What the daemon passes on about the connection.
struct Connection {
    std::string module;
    std::string account;
    std::string number;

    static Connection FromEnvironment() {
        const auto value = [](const char* name) -> std::string {
            const char* const text = getenv(name);
            return text != nullptr ? text : "";
        };
        return {value("RSYNC_MODULE_NAME"), value("RSYNC_USER_NAME"), value("RSYNC_PID")};
    }
};

// What is open for the connection.
std::optional<OpenModule> ModuleOf(const Connection& connection) {
    return connection.module == TARQ::Backup::kPushModule ? FindPushOf(connection.number)
                                                          : FindModule(connection.module);
}

// The arguments of the daemon's rsync, without the program name. Empty when there are more than any
// of the client's runs has.
std::vector<std::string> ArgumentsOfRun() {
    std::vector<std::string> words;
    for (;;) {
        const char* const word = getenv(("RSYNC_ARG" + std::to_string(words.size() + 1)).c_str());
        if (word == nullptr) {
            return words;
        }
        if (words.size() == kMaxArguments) {
            return {};
        }
        words.emplace_back(word);
    }
}

bool IsProcess(const std::string& number) {
    return base::ParseNumber(number, INT32_MAX).has_value();
}

// Why the run may not use the module; empty when it may.
std::string RefusalOfRun(const OpenModule& module, const Transfer& run) {
    // Whoever may push may also do a dry run; but one in a connection is that.
    const bool fits =
        run.does == module.access ||
        (run.does == Access::kCompare && module.access == Access::kWrite && module.process.empty());
    if (fits) {
        return "";
    }
    switch (module.access) {
        case Access::kWrite:
            return "This share is open for a push: nothing is read from it meanwhile.";
        case Access::kCompare:
            return "This share is open for a dry run alone.";
        default:
            return "This share is open for reading alone.";
    }
}

int Refuse(const std::string& reason) {
    puts(reason.c_str());  // the daemon shows it to the client
    return 1;
}

}  // namespace

int AdmitTransfer() {
    const Connection connection = Connection::FromEnvironment();
    if (!IsAccountName(connection.account) || !IsProcess(connection.number)) {
        return Refuse("This share takes pushes of the synchronisation service only.");
    }
    const RegistryLock lock;
    if (!lock.Held()) {
        return Refuse("The server cannot take its own lock: see 'zel_server status' there.");
    }
    CloseSilentModules();
    const auto module = ModuleOf(connection);
    if (!module || module->account != connection.account) {
        return Refuse("Nothing of this name is open for this account.");
    }
    ShareState state;
    const Switch on = ReadSwitch();
    const ReadResult read = ReadShare(module->share, state);
    if (on == Switch::kUnknown || read != ReadResult::kRead) {
        return Refuse("The server's registry is damaged: see 'zel_server status' there.");
    }
    if (on == Switch::kOff) {
        return Refuse("The synchronisation service is switched off.");
    }
    if (state.account != connection.account) {
        return Refuse("This share belongs to another account.");
    }
    if (module->access == Access::kWrite && state.running_id != module->client) {
        return Refuse("No push into this share has been started.");
    }
    std::string why;
    const auto run = JudgeTransfer(ArgumentsOfRun(), why);
    if (!run) {
        return Refuse("Refused: " + why + ".");
    }
    const std::string refusal = RefusalOfRun(*module, *run);
    if (!refusal.empty()) {
        return Refuse(refusal);
    }
    if (run->does == Access::kWrite && getenv(kGuardVariable) == nullptr) {
        return Refuse(
            "The server's rsync cannot load the guard of versions: install zel-server again "
            "there.");
    }
    if (run->does == Access::kWrite && !PrepareVersions(module->share, state.path, run->id)) {
        return Refuse("The server cannot keep what this push replaces: is its disk full?");
    }
    if (run->does == Access::kWrite && !PreparePartials(state.path, run->id, run->resumes)) {
        return Refuse(run->resumes
                          ? "There is no part of a file with which this push could go on."
                          : "The server cannot make room for what this push sends: is its disk "
                            "full?");
    }
    if (run->by_content) {
        base::GiveWay(static_cast<pid_t>(*base::ParseNumber(connection.number, INT32_MAX)));
    }
    return BeginTransferIn(*module, connection.number, run->id)
               ? 0
               : Refuse("The server cannot note the transfer: is its disk full?");
}

namespace {

bool IsWritingInto(const std::string& share, const std::string& process) {
    const std::map<std::string, pid_t> running = TransfersInto(share);
    return std::any_of(running.begin(), running.end(), [&](const auto& transfer) {
        return std::to_string(transfer.second) == process;
    });
}

int NoteEnd() {
    const Connection connection = Connection::FromEnvironment();
    if (!IsAccountName(connection.account) || !IsProcess(connection.number)) {
        return 0;
    }
    if (connection.module == TARQ::Backup::kCommandModule) {
        RemoveAnswer(connection.account, connection.number);
        return 0;
    }
    const RegistryLock lock;
    if (!lock.Held()) {
        return 1;
    }
    // Also when the share's module was closed before the transfer had ended.
    // And when another push of the share has begun in the place of this one.
    std::string share = ShareOfModule(connection.module);
    std::optional<OpenModule> push;
    bool wrote = false;
    if (connection.module == TARQ::Backup::kPushModule) {
        unlink(LinkOfPush(connection.number).c_str());
        const auto open = FindModuleOfTransfer(connection.number);
        share = open ? open->share : "";
        push = FindPushOf(connection.number);
        wrote = push && IsWritingInto(share, connection.number);
    }
    ShareState ended;
    if (IsShareName(share) && EndWritingInto(share, connection.number) &&
        ReadShare(share, ended) == ReadResult::kRead) {
        TakeVersions(share, ended.path);
        SettlePartials(share, ended.path);
        const char* const result = getenv("RSYNC_EXIT_STATUS");
        NoteWritten(connection.account, FolderAbove(ended.path), BytesWrittenBy(connection.number),
                    result != nullptr && strcmp(result, kCannotWrite) == 0);
    }
    if (push) {
        const char* const result = getenv("RSYNC_EXIT_STATUS");
        return EndInConnection(*push, result != nullptr ? result : "", wrote) ? 0 : 1;
    }
    const auto module = FindModule(connection.module);
    if (!module || module->account != connection.account) {
        return 0;
    }
    EndTransferIn(*module, connection.number);
    const char* const status = getenv("RSYNC_EXIT_STATUS");
    ShareState state;
    // Reading does not change the result of the last push. If the client has already reported the
    // end of its push (`running_id` is empty), that report is kept.
    if (module->access != Access::kWrite || status == nullptr || !base::ParseNumber(status, 255) ||
        ReadShare(module->share, state) != ReadResult::kRead ||
        state.account != connection.account || state.running_id.empty()) {
        return 0;
    }
    state.last_result = status;
    state.last_time = std::to_string(time(nullptr));
    return WriteShare(module->share, state) ? 0 : 1;
}

}  // namespace

int EndTransfer() {
    const int status = NoteEnd();
    // Nobody waits for this process.
    if (const auto config = LoadServerConfig()) {
        RemovePastTrees(*config,
                        [](const std::string& name) { return FindModule("." + name).has_value(); });
    }
    return status;
}

}  // namespace zel_server
