#include "programs/zel_server/transfer.h"

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>

#include "base/text.h"
#include "programs/common/text.h"
#include "programs/zel_server/answers.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

constexpr int kMaxArguments = 256;

// What the daemon tells of the connection.
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

// True for a run that leaves the share as it is: the client reads, or only asks what would change.
// The client's word is what the daemon's own rsync acts on.
bool LeavesShareAlone() {
    for (int i = 1; i < kMaxArguments; ++i) {
        const char* const argument = getenv(("RSYNC_ARG" + std::to_string(i)).c_str());
        const std::string text = argument != nullptr ? argument : ".";
        if (text == ".") {  // paths follow
            return false;
        }
        if (text == "--sender" || text == "--dry-run") {
            return true;
        }
        // Single letters stand together; behind an "e" come the client's capabilities.
        if (text.size() > 1 && text[0] == '-' && text[1] != '-' &&
            text.substr(0, text.find('e')).find('n') != std::string::npos) {
            return true;
        }
    }
    return false;
}

int Refuse(const char* reason) {
    puts(reason);  // shown to the client by the daemon
    return 1;
}

}  // namespace

int AdmitTransfer() {
    const Connection connection = Connection::FromEnvironment();
    const std::string share = ShareOfModule(connection.module);
    ShareState state;
    if (!IsShareName(share) || !IsAccountName(connection.account)) {
        return Refuse("This share takes pushes of the synchronisation service only.");
    }
    const Switch on = ReadSwitch();
    const ReadResult read = ReadShare(share, state);
    if (on == Switch::kUnknown || read == ReadResult::kDamaged || read == ReadResult::kFailed) {
        return Refuse("The server's registry is damaged: see 'zel_server status' there.");
    }
    if (on == Switch::kOff) {
        return Refuse("The synchronisation service is switched off.");
    }
    if (read != ReadResult::kRead || state.module != connection.module) {
        return Refuse("This share is not known to the synchronisation service.");
    }
    if (state.account != connection.account) {
        return Refuse("This share belongs to another account.");
    }
    if (state.running_id.empty() && !LeavesShareAlone()) {
        return Refuse("No push into this share has been started.");
    }
    return 0;
}

int EndTransfer() {
    const Connection connection = Connection::FromEnvironment();
    if (!IsAccountName(connection.account)) {
        return 0;
    }
    if (connection.module == TARQ::Backup::kCommandModule) {
        if (base::ParseNumber(connection.number, UINT32_MAX)) {
            RemoveAnswer(connection.account, connection.number);
        }
        return 0;
    }
    const std::string share = ShareOfModule(connection.module);
    const char* const status = getenv("RSYNC_EXIT_STATUS");
    const RegistryLock lock;
    ShareState state;
    // After a push is closed, later connections only read or ask: they say nothing about the copy.
    // The client may have said that its push failed before the daemon, which knows why, comes here.
    if (!lock.Held() || status == nullptr || !base::ParseNumber(status, 255) ||
        !IsShareName(share) || ReadShare(share, state) != ReadResult::kRead ||
        state.account != connection.account || state.running_id.empty()) {
        return 0;
    }
    state.last_result = status;
    state.last_time = std::to_string(time(nullptr));
    return WriteShare(share, state) ? 0 : 1;
}

}  // namespace zel_server
