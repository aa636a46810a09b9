#include <systemd/sd-daemon.h>
#include <tarq/core.h>
#include <tarq/root_path.h>
#include <tarq/systemd.h>

#include <algorithm>
#include <cctype>
#include <cstring>
#include <memory>
#include <string>

#include "platform/tarqsystemd/bus_units.h"
#include "platform/tarqsystemd/supervisor.h"
#include "platform/tarqsystemd/unit_manager.h"

namespace {

using tarq_systemd::Outcome;
using tarq_systemd::Status;
using tarq_systemd::UnitManager;

constexpr char kSource[] = "tarq/systemd";
constexpr size_t kMaxUnitName = 200;  // with a suffix of ours it still is a file's name

std::unique_ptr<UnitManager> Manager() {
    if (TARQ::RootFolder().empty() && sd_booted() > 0) {
        return std::make_unique<tarq_systemd::BusUnits>(tarq_systemd::ConnectManagerBus());
    }
    return std::make_unique<tarq_systemd::Supervisor>();
}

/// Sets the error code when it is none. A unit's name becomes part of a path and a section's name.
bool IsUnitName(const char* unit) {
    const auto allowed = [](char c) {
        return isalnum(static_cast<unsigned char>(c)) != 0 ||
               (c != '\0' && strchr("_-.:@", c) != nullptr);
    };
    const std::string name = unit == nullptr ? "" : unit;
    if (name.empty() || name.size() > kMaxUnitName || name.front() == '.' ||
        !std::all_of(name.begin(), name.end(), allowed)) {
        KAPICErrSetEx(TARQ_ERR_BAD_PARAMETER, kSource, __LINE__);
        return false;
    }
    return true;
}

int Verdict(Outcome outcome) {
    if (outcome == Outcome::kBusy) {
        KAPICErrSetEx(TARQ_ERR_SERVICE_BUSY, kSource, __LINE__);
    }
    return outcome == Outcome::kDone ? 1 : 0;
}

}  // namespace

tarq_systemd::Outcome tarq_systemd::Failed(int code, int line) {
    KAPICErrSetEx(code, kSource, line);
    return Outcome::kFailed;
}

int TARQSystemdActiveStatusGet(const char* unit) {
    if (!IsUnitName(unit)) {
        return -1;
    }
    switch (Manager()->StatusOf(unit)) {
        case Status::kActive:
            return 1;
        case Status::kInactive:
            return 0;
        case Status::kUnknown:
            break;
    }
    return -1;
}

int TARQSystemdStart(const char* unit) {
    return IsUnitName(unit) ? Verdict(Manager()->Start(unit)) : 0;
}

int TARQSystemdStop(const char* unit) {
    return IsUnitName(unit) ? Verdict(Manager()->Stop(unit)) : 0;
}
