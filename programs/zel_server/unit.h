// The unit zel_rsyncd, under which the system manager runs the rsync daemon.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace zel_server {

inline constexpr char kUnit[] = "zel_rsyncd";

/// What a unit may write to: the manager's word for how it is confined.
class Confinement {
public:
    /// `lines`: Key=Value, as a unit file and `systemctl show` have them; what says nothing about
    /// folders is passed over.
    explicit Confinement(const std::string& lines);

    /// Why the unit cannot put anything into `folder` (a path without links), such as
    /// "ProtectSystem=full"; empty when it can.
    std::string Forbids(const std::string& folder) const;

private:
    void Add(const std::string& path, const std::string& why);
    void AddListed(const std::string& paths, const std::string& why);

    std::map<std::string, std::string> rules_;  // folder to reason; empty: may be written
};

/// The unit as the manager has it now. `managed` is false where no manager runs, below a root
/// folder of one's own, and where the manager does not know the unit.
struct UnitState {
    bool managed = false;
    bool masked = false;
    bool enabled = false;  ///< starts with the machine
    std::string active;    ///< "active", "activating", "failed", "inactive" ...
    std::string result;    ///< why it failed: "exit-code" ...
    Confinement confinement = Confinement("");
};

/// Asks the manager. Without one, but for the whole machine, the confinement is the one that the
/// unit is shipped with: it will hold when the machine is started.
UnitState AskUnit();

/// Run the manager's commands for the unit and wait. False when it refuses; it has said why on
/// standard error.
bool EnableUnit();
bool StartUnit();
bool RestartUnit();

}  // namespace zel_server
