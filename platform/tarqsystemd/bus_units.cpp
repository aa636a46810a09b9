#include "platform/tarqsystemd/bus_units.h"

#include <tarq/core.h>

#include <algorithm>
#include <cerrno>

namespace tarq_systemd {
namespace {

// The manager ends jobs by itself, after 90 seconds unless the unit says otherwise: this only keeps
// the caller from waiting for ever on a manager that has lost a job.
constexpr std::chrono::seconds kJobLimit(300);

constexpr const char* kSuffixes[] = {".service", ".socket",    ".target", ".timer",
                                     ".mount",   ".path",      ".slice",  ".scope",
                                     ".swap",    ".automount", ".device"};

std::string FullName(const std::string& unit) {
    const auto ends_with = [&](const std::string& suffix) {
        return unit.size() > suffix.size() &&
               unit.compare(unit.size() - suffix.size(), suffix.size(), suffix) == 0;
    };
    return std::any_of(std::begin(kSuffixes), std::end(kSuffixes), ends_with) ? unit
                                                                              : unit + ".service";
}

}  // namespace

Status BusUnits::StatusOf(const std::string& unit) {
    UnitState state;
    if (!GetState(unit, &state)) {
        Failed(TARQ_ERR_SERVICE);
        return Status::kUnknown;
    }
    return state.active == "active" || state.active == "reloading" ? Status::kActive
                                                                   : Status::kInactive;
}

Outcome BusUnits::Start(const std::string& unit) {
    UnitState state;
    if (!GetState(unit, &state)) {
        return Failed(TARQ_ERR_SERVICE);
    }
    // A unit that waits for its next attempt after a failure is "activating" too, and may be
    // started at once.
    if (state.active == "activating" && state.sub != "auto-restart") {
        return Outcome::kBusy;
    }
    return Run("StartUnit", unit);
}

Outcome BusUnits::Stop(const std::string& unit) {
    const Outcome outcome = Run("StopUnit", unit);
    if (outcome == Outcome::kDone) {
        return outcome;
    }
    // The manager refuses to stop a unit that is not loaded; such a unit is stopped already.
    const int reason = errno;
    UnitState state;
    if (GetState(unit, &state) && (state.active == "inactive" || state.active == "failed")) {
        return Outcome::kDone;
    }
    errno = reason;
    return outcome;
}

Outcome BusUnits::Run(const char* method, const std::string& unit) {
    std::string result;
    const int error = bus_ ? bus_->RunJob(method, FullName(unit), kJobLimit, &result) : -ENOTCONN;
    if (error < 0 || result != "done") {
        errno = error < 0 ? -error : EIO;
        return Failed(TARQ_ERR_SERVICE);
    }
    return Outcome::kDone;
}

bool BusUnits::GetState(const std::string& unit, UnitState* state) {
    const int error = bus_ ? bus_->GetState(FullName(unit), state) : -ENOTCONN;
    if (error < 0) {
        errno = -error;
    }
    return error >= 0;
}

}  // namespace tarq_systemd
