// The few calls of the system manager's bus interface that units need: a thin seam, so that what
// stands above it is tested without a bus.
#pragma once

#include <chrono>
#include <memory>
#include <string>

namespace tarq_systemd {

struct UnitState {
    std::string
        active;       ///< "active", "reloading", "inactive", "failed", "activating", "deactivating"
    std::string sub;  ///< finer, the unit kind's own: "running", "auto-restart"
};

/// One connection; one thread. Every call gives 0 or a negative errno.
class ManagerBus {
public:
    virtual ~ManagerBus() = default;
    /// `unit` with its suffix. A unit that is not there is "inactive".
    virtual int GetState(const std::string& unit, UnitState* state) = 0;
    /// Calls the manager's `method` (StartUnit, StopUnit) in mode "replace" and waits at most
    /// `limit` for the job that it queues. `result` is then the manager's word for the job's end:
    /// "done" when all went well.
    virtual int RunJob(const char* method, const std::string& unit, std::chrono::seconds limit,
                       std::string* result) = 0;
};

/// The machine's own manager. nullptr, with errno set, when its bus cannot be reached.
std::unique_ptr<ManagerBus> ConnectManagerBus();

}  // namespace tarq_systemd
