#pragma once

#include <sys/types.h>

#include <chrono>

#include "platform/tarqrsync/link_watch.h"

namespace TARQ {
namespace Backup {

/// How long a run waits for the far end.
struct Patience {
    std::chrono::seconds connect;  ///< for a connection, where the watch cannot see that it is up
    std::chrono::seconds begin;    ///< from then until the run begins; 0: for ever
    std::chrono::seconds dead;     ///< while nothing that was sent is answered at all
};

/// Sees, while a run goes on, whether anything moves and whether it still has a far end. A far end
/// that is alive and works in silence is given all the time that it takes.
class RunWatch {
public:
    enum class Fault {
        NONE,
        SILENT,     ///< the far end took the connection and has said nothing
        NOT_BEGUN,  ///< it has said something, but the run has not begun in time
        DEAD        ///< it is there no longer, or no way to it
    };

    explicit RunWatch(const Patience& patience) : patience_(patience) {}

    /// From when there is a process to look at.
    void Started(pid_t rsync);
    /// rsync has written something.
    void Spoke() { moved_ = Clock::now(); }
    /// Looks, about once a second however often it is called. `begun`: whether the far end has let
    /// the run begin.
    Fault Look(bool begun);

    unsigned int SecondsStill() const;

private:
    using Clock = std::chrono::steady_clock;

    const Patience patience_;
    pid_t rsync_ = -1;
    LinkWatch link_watch_;
    LinkState link_;
    Clock::time_point started_ = Clock::now();
    Clock::time_point connected_;  // when link_.connected became true
    Clock::time_point moved_ = started_;
    Clock::time_point next_look_ = started_ + std::chrono::seconds(1);
};

}  // namespace Backup
}  // namespace TARQ
