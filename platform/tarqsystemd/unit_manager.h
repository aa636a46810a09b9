// What starts and stops units: the system manager, or the supervisor where there is none.
#pragma once

#include <memory>
#include <string>

namespace tarq_systemd {

enum class Outcome {
    kDone,
    kFailed,  ///< the error code is set
    kBusy     ///< the unit is being started by someone else
};

enum class Status { kActive, kInactive, kUnknown /* the error code is set */ };

/// Units are named without a slash and are not empty: the operations have looked.
class UnitManager {
public:
    virtual ~UnitManager() = default;
    virtual Status StatusOf(const std::string& unit) = 0;
    virtual Outcome Start(const std::string& unit) = 0;
    virtual Outcome Stop(const std::string& unit) = 0;
};

/// Sets the error code to `code` with a position in this library, and gives kFailed.
Outcome Failed(int code, int line);

}  // namespace tarq_systemd
