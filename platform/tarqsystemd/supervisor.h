// A plain supervisor for machines without a system manager, and for root folders: see
// tarq/systemd.h.
#pragma once

#include <string>

#include "platform/tarqsystemd/unit_manager.h"

namespace tarq_systemd {

/// Keeps no state of its own: who runs is in the pid files, which hold the process's number and, on
/// a second line, the time that it started at.
class Supervisor : public UnitManager {
public:
    Status StatusOf(const std::string& unit) override;
    Outcome Start(const std::string& unit) override;
    Outcome Stop(const std::string& unit) override;
};

}  // namespace tarq_systemd
