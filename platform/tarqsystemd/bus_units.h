// Units of the system manager.
#pragma once

#include <memory>
#include <string>

#include "platform/tarqsystemd/manager_bus.h"
#include "platform/tarqsystemd/unit_manager.h"

namespace tarq_systemd {

class BusUnits : public UnitManager {
public:
    /// `bus` may be null: then every call fails.
    explicit BusUnits(std::unique_ptr<ManagerBus> bus) : bus_(std::move(bus)) {}

    Status StatusOf(const std::string& unit) override;
    Outcome Start(const std::string& unit) override;
    Outcome Stop(const std::string& unit) override;

private:
    Outcome Run(const char* method, const std::string& unit);
    bool GetState(const std::string& unit, UnitState* state);

    const std::unique_ptr<ManagerBus> bus_;
};

}  // namespace tarq_systemd
