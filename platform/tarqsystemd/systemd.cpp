#include <systemd/sd-daemon.h>
#include <tarq/core.h>
#include <tarq/root_path.h>
#include <tarq/systemd.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <string>

#include "base/text.h"
#include "platform/tarqsystemd/bus_units.h"
#include "platform/tarqsystemd/supervisor.h"
#include "platform/tarqsystemd/unit_manager.h"

namespace {

using tarq_internal::Guarded;
using tarq_systemd::Outcome;
using tarq_systemd::Status;
using tarq_systemd::UnitManager;

constexpr size_t kMaxUnitName = 200;  // still a valid file name with our suffix

std::unique_ptr<UnitManager> Manager() {
    if (TARQ::RootFolder().empty() && sd_booted() > 0) {
        return std::make_unique<tarq_systemd::BusUnits>(tarq_systemd::ConnectManagerBus());
    }
    return std::make_unique<tarq_systemd::Supervisor>();
}

/// Sets the error code when it is none. A unit's name becomes part of a path and a section's name.
bool IsUnitName(const char* unit) {
    const auto allowed = [](char c) {
        return base::IsLetterOrDigit(c) || (c != '\0' && strchr("_-.:@", c) != nullptr);
    };
    const std::string name = unit == nullptr ? "" : unit;
    if (name.empty() || name.size() > kMaxUnitName || name.front() == '.' ||
        !std::all_of(name.begin(), name.end(), allowed)) {
        tarq_systemd::Failed(TARQ_ERR_BAD_PARAMETER);
        return false;
    }
    return true;
}

int Verdict(Outcome outcome) {
    if (outcome == Outcome::kBusy) {
        tarq_systemd::Failed(TARQ_ERR_SERVICE_BUSY);
    }
    return outcome == Outcome::kDone ? 1 : 0;
}

}  // namespace

int TARQSystemdActiveStatusGet(const char* unit) {
    return Guarded(-1, [&] {
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
    });
}

int TARQSystemdStart(const char* unit) {
    return Guarded(0, [&] { return IsUnitName(unit) ? Verdict(Manager()->Start(unit)) : 0; });
}

int TARQSystemdStop(const char* unit) {
    return Guarded(0, [&] { return IsUnitName(unit) ? Verdict(Manager()->Stop(unit)) : 0; });
}
