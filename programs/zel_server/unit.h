// The units under which the system manager runs the server.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace zel_server {

inline constexpr char kUnit[] = "zel_rsyncd";      ///< zel_server serve
inline constexpr char kFrontUnit[] = "zel_front";  ///< HAProxy; starts and stops with zel_rsyncd

/// What a unit may write to, according to its confinement by the service manager.
class Confinement {
public:
    /// `lines`: Key=Value, as in a unit file or the output of `systemctl show`; settings that do
    /// not concern folders are ignored.
    explicit Confinement(const std::string& lines);

    /// What prevents the unit from writing to `folder` (a path without links), such as
    /// "ProtectSystem=full"; empty when nothing does.
    std::string Forbids(const std::string& folder) const;

private:
    void Add(const std::string& path, const std::string& why);
    void AddListed(const std::string& paths, const std::string& why);

    std::map<std::string, std::string> rules_;  // folder to reason; empty: writable
};

/// The unit's current state in the service manager. `managed` is false below a root folder, and
/// where no manager runs or it does not know the unit.
struct UnitState {
    bool managed = false;
    bool masked = false;
    bool enabled = false;  ///< starts at boot
    std::string active;    ///< "active", "activating", "failed", "inactive" ...
    std::string result;    ///< why it failed: "exit-code" ...
    Confinement confinement = Confinement("");
};

/// Queries the service manager. A system-wide server without one has the confinement of the shipped
/// unit, which will apply once the machine has started.
UnitState AskUnit(const char* unit = kUnit);

/// Run commands of the service manager for kUnit and wait. False when they fail; the manager has
/// then printed the reason on standard error.
bool EnableUnit();
bool StartUnit();
bool RestartUnit();

}  // namespace zel_server
