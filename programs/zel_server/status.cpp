#include "programs/zel_server/status.h"

#include <cstdio>
#include <nlohmann/json.hpp>

#include "ZEL/is_syncedshare.h"
#include "programs/common/failure.h"
#include "programs/common/json_text.h"
#include "programs/common/text.h"
#include "programs/zel_server/health.h"
#include "programs/zel_server/names.h"

namespace zel_server {

namespace {

using Json = nlohmann::ordered_json;
using programs::Printable;

// The registry as the library reads it.
class Report {
public:
    Report() : read_(zel_svr_get_status(&status_) == 0) {}
    ~Report() {
        if (read_) {
            zel_svr_put_status(&status_);
        }
    }
    Report(const Report&) = delete;
    Report& operator=(const Report&) = delete;

    bool Serving() const { return status_.enabled != 0; }
    bool Busy() const { return status_.busy != 0; }
    bool Several() const { return Client() == kMultiSourceMarker; }
    std::string Client() const {
        return read_ && status_.client_id != nullptr ? status_.client_id : "";
    }

private:
    zel_svr_status status_ = {};
    bool read_;
};

template <typename Value>
Json OrNull(const std::optional<Value>& value) {
    return value ? Json(*value) : Json(nullptr);
}

Json OnOrNull(Switch on) {
    return on == Switch::kUnknown ? Json(nullptr) : Json(on == Switch::kOn);
}

void PrintJson(const ServerConfig& config, const Report& report, const Health& health) {
    const StorageHealth& storage = health.storage.front();
    Json problems = Json::array();
    for (const Problem& problem : health.problems) {
        problems.push_back({{"what", problem.what},
                            {"mend", problem.mend},
                            {"stops_pushes", problem.stops_pushes}});
    }
    Json folders = Json::array();
    for (const StorageHealth& folder : health.storage) {
        folders.push_back({{"folder", folder.folder},
                           {"state", Word(folder.state)},
                           {"full", folder.full},
                           {"free_bytes", OrNull(folder.free_bytes)}});
    }
    const bool managed = health.unit.managed;
    const auto& other = health.other_holder;
    const Json object = {
        {"pushes_can_succeed", health.PushesCanSucceed()},
        {"switched_on", OnOrNull(health.on)},
        {"serving", report.Serving()},
        {"busy", report.Busy()},
        {"registry", health.registry},
        {"pairing", report.Several()          ? "several"
                    : report.Client().empty() ? "none"
                                              : "single"},
        {"client",
         report.Several() || report.Client().empty() ? Json(nullptr) : Json(report.Client())},
        {"unit_state", managed ? Json(health.unit.active) : Json(nullptr)},
        {"unit_enabled", managed ? Json(health.unit.enabled) : Json(nullptr)},
        {"daemon_running", health.daemon.has_value()},
        {"daemon_pid", OrNull(health.daemon)},
        {"listening", health.listens},
        {"configuration_newer", health.configuration_newer},
        {"front_pid", OrNull(health.front)},
        {"fingerprint", OrNull(health.fingerprint)},
        {"port", config.tls_port},
        {"plain_port", config.plain_port},
        {"plain_for_network", config.plain},
        {"address", config.address.empty() ? Json(nullptr) : Json(config.address)},
        {"port_holder", other ? Json(other->program) : Json(nullptr)},
        {"port_holder_pid", other ? Json(other->pid) : Json(nullptr)},
        {"accounts", OrNull(health.accounts)},
        {"shares", OrNull(health.shares)},
        {"storage", config.storage},
        {"storage_there", storage.state == StorageState::kReady},
        {"free_bytes", OrNull(storage.free_bytes)},
        {"folders", folders},
        {"problems", problems}};
    puts(programs::JsonText(object).c_str());
}

std::string StorageText(const StorageHealth& storage) {
    switch (storage.state) {
        case StorageState::kAbsent:
            return "NOT THERE";
        case StorageState::kOtherDisk:
            return "ITS DISK IS NOT MOUNTED";
        case StorageState::kReadOnly:
            return "READ-ONLY";
        case StorageState::kNotPermitted:
            return "MAY NOT BE WRITTEN";
        case StorageState::kOpen:
            return "OPEN TO OTHERS";
        case StorageState::kNoAttributes:
            return "KEEPS NO ATTRIBUTES";
        case StorageState::kReady:
            break;
    }
    if (storage.full) {
        return "FULL";
    }
    return storage.free_bytes ? programs::HumanBytes(*storage.free_bytes) + " free"
                              : "free space unknown";
}

void PrintLine(const char* label, const std::string& text) {
    printf("%-9s %s\n", label, text.c_str());
}

std::string Where(const ServerConfig& config) {
    return config.address.empty() ? "" : " of " + config.address;
}

void PrintText(const ServerConfig& config, const Report& report, const Health& health) {
    PrintLine("Serving:", health.PushesCanSucceed() ? "yes" : "NO");
    PrintLine("Switch:", health.on == Switch::kOn    ? "on"
                         : health.on == Switch::kOff ? "off"
                                                     : "unknown");
    if (health.unit.managed) {
        PrintLine("Unit:", std::string(kUnit) + " " + health.unit.active +
                               (health.unit.enabled ? ", starts with the machine" : ""));
    }
    PrintLine("Daemon:", health.daemon ? "running, process " + std::to_string(*health.daemon)
                                       : std::string("not running"));
    PrintLine("Port:", std::to_string(config.tls_port) + Where(config) + ", TLS");
    PrintLine(
        "", std::to_string(config.plain_port) +
                (config.plain ? Where(config) + ", UNPROTECTED" : " for this machine and for ssh"));
    PrintLine("Key:", health.fingerprint.value_or("not to be read"));
    PrintLine("Busy:", report.Busy() ? "yes" : "no");
    PrintLine("Paired:", report.Several()          ? "several clients"
                         : report.Client().empty() ? "none"
                                                   : Printable(report.Client()));
    PrintLine("Accounts:",
              health.accounts ? std::to_string(*health.accounts) : std::string("unknown"));
    PrintLine("Shares:", health.shares ? std::to_string(*health.shares) : std::string("unknown"));
    const char* label = "Storage:";
    for (const StorageHealth& storage : health.storage) {
        PrintLine(label, storage.folder + " (" + StorageText(storage) + ")");
        label = "";
    }
    for (const Problem& problem : health.problems) {
        printf("\n%s %s\n%-9s %s\n",
               problem.stops_pushes ? "Problem: " : "Note:    ", problem.what.c_str(),
               "Mend:", problem.mend.c_str());
    }
}

}  // namespace

void ShowStatus(bool as_json) {
    const ServerConfig config = RequireServerConfig();
    const Health health = Examine(config);
    const Report report;
    (as_json ? PrintJson : PrintText)(config, report, health);
    if (!health.PushesCanSucceed()) {
        throw programs::ReportedFailure(programs::FailureKind::kFailed);
    }
}

}  // namespace zel_server
