// What starts and stops units: the system manager, or the supervisor where there is none.
#pragma once

#include <string>

#include "platform/internal/error.h"

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

/// Sets the error code, errno kept, and gives kFailed.
inline Outcome Failed(int code, int line = __builtin_LINE()) {
    tarq_internal::Fail(code, line);
    return Outcome::kFailed;
}

}  // namespace tarq_systemd
