// Client of the daemon: requests and replies as in docs/daemon-protocol.md.
#pragma once

#include <optional>
#include <string>

#include "ZEL/channel.h"
#include "ZEL/pobject.h"
#include "programs/common/failure.h"

namespace zelctl {

/// Why the daemon cannot be asked.
enum class DaemonFault {
    kNone,          ///< it can be asked, or it has refused the request
    kNotRunning,    ///< nobody listens
    kNotPermitted,  ///< this user has no access
    kSilent,        ///< it listens, but does not answer or closes the connection
    kOther
};

/// A connection to the daemon. After an operation has thrown Failure, only Fault() may be called.
/// The text of the failure is printable; it is empty when a signal that WatchForInterrupt() noted
/// ended the wait (kCancelled).
///
/// Threads: for use by one thread.
class DaemonConnection {
public:
    DaemonConnection();

    void Connect();
    void Send(const ZEL::PObject& request);
    /// The next reply. Throws Failure for an error reply.
    ZEL::PObject Receive();

    DaemonFault Fault() const { return fault_; }

private:
    programs::Failure CannotConnect(const std::string& path, int error);
    programs::Failure Lost();

    DaemonFault fault_ = DaemonFault::kNone;
    ZEL::Channel channel_;
};

/// Sends one request on a connection of its own, and returns the reply. Throws Failure likewise.
ZEL::PObject AskDaemon(const ZEL::PObject& request);
/// The same for an optional daemon: nothing when it cannot be asked or refuses.
std::optional<ZEL::PObject> TryToAskDaemon(const ZEL::PObject& request);

/// A request about one task.
ZEL::PObject TaskRequest(const char* command, const std::string& task);

/// The daemon's socket, below the root folder if there is one.
std::string DaemonSocket();

}  // namespace zelctl
