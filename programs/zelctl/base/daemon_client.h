// Talking to the daemon: requests and replies of docs/daemon-protocol.md.
#pragma once

#include <optional>
#include <string>

#include "ZEL/channel.h"
#include "ZEL/pobject.h"
#include "programs/common/failure.h"

namespace zelctl {

/// Why the daemon cannot be asked.
enum class DaemonFault {
    kNone,          ///< it can, or it has refused a request
    kNotRunning,    ///< nobody listens
    kNotPermitted,  ///< this user may not ask
    kSilent,        ///< it listens, and does not answer or breaks off
    kOther
};

/// A connection to the daemon. Once an operation has thrown Failure, it is only good for Fault().
/// The text is printable, and empty when an interrupt, noted by WatchForInterrupt(), ended a wait
/// (kCancelled).
///
/// Threads: one thread.
class DaemonConnection {
public:
    DaemonConnection();

    void Connect();
    void Send(const ZEL::PObject& request);
    /// The next reply. An error reply is a failure.
    ZEL::PObject Receive();

    DaemonFault Fault() const { return fault_; }

private:
    programs::Failure CannotConnect(const std::string& path, int error);
    programs::Failure Lost();

    DaemonFault fault_ = DaemonFault::kNone;
    ZEL::Channel channel_;
};

/// One request and its reply, on a connection of its own. Throws Failure as that does.
ZEL::PObject AskDaemon(const ZEL::PObject& request);
/// The same of a daemon that need not be there: nothing when it cannot be asked, or refuses.
std::optional<ZEL::PObject> TryToAskDaemon(const ZEL::PObject& request);

/// A request about one task.
ZEL::PObject TaskRequest(const char* command, const std::string& task);

/// The daemon's socket, below the root folder when there is one.
std::string DaemonSocket();

}  // namespace zelctl
