#pragma once

#include <linux/inet_diag.h>
#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <vector>

#include "base/unique_fd.h"

namespace TARQ {
namespace Backup {

/// What the kernel knows of a program's TCP connections, all together.
struct LinkState {
    bool connected = false;              ///< one is up, or has been
    uint64_t bytes_sent = 0;             ///< that the far ends have acknowledged
    uint64_t bytes_received = 0;         ///< from there
    std::chrono::seconds unanswered{0};  ///< since when what was sent has met no answer at all
};

/// Looks at the connections of a program and its children to others, from outside, so that a peer
/// that is dead can be told from one that works and is silent: the kernel of the second still
/// answers.
///
/// Where the kernel does not tell (no inet_diag, a process that may not be looked at) there is
/// never a connection.
class LinkWatch {
public:
    /// What there is to know now. Call it about once a second: once the connections are found it
    /// costs two system calls for each.
    LinkState Look(pid_t program);

private:
    using Clock = std::chrono::steady_clock;

    struct Connection {
        inet_diag_sockid id;
        uint8_t family;
        Clock::time_point answered;  // until then everything was
    };

    void Find(pid_t program);
    void Ask(Connection& connection, LinkState& state);

    base::UniqueFd kernel_;
    std::vector<Connection> connections_;
    LinkState last_;  // of connections that are closed by now
};

}  // namespace Backup
}  // namespace TARQ
