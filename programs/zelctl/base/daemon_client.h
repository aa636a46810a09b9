// Talking to the daemon: requests and replies of docs/daemon-protocol.md.
#pragma once

#include <string>

#include "ZEL/channel.h"
#include "ZEL/pobject.h"
#include "programs/zelctl/base/exit_codes.h"

namespace zelctl {

/// Why the daemon cannot be asked.
enum class DaemonFault {
    kNone,          ///< it can, or it has refused a request
    kNotRunning,    ///< nobody listens
    kNotPermitted,  ///< this user may not ask
    kSilent,        ///< it listens, and does not answer or breaks off
    kOther
};

/// A connection to the daemon. After another code than kOk it is only good for Error() and Tell().
///
/// Threads: one thread.
class DaemonConnection {
public:
    DaemonConnection();

    ExitCode Connect();
    ExitCode Send(const ZEL::PObject& request);
    /// The next reply into `reply`, which is emptied first. An error reply is a failure.
    ExitCode Receive(ZEL::PObject& reply);

    /// What failed and what to do, printable; empty when an interrupt, noted by
    /// WatchForInterrupt(), ended a wait (kCancelled).
    const std::string& Error() const { return error_; }
    DaemonFault Fault() const { return fault_; }
    /// Tells the person, if there is something to tell. Gives `code` back.
    ExitCode Tell(ExitCode code) const;

private:
    ExitCode Failed(ExitCode code, const std::string& error);
    ExitCode CannotConnect(const std::string& path, int error);
    ExitCode Lost();

    std::string error_;
    DaemonFault fault_ = DaemonFault::kNone;
    ZEL::Channel channel_;
};

/// One request and its reply, on a connection of its own. A failure is told to the person, or goes
/// to `error` when that is given.
ExitCode AskDaemon(const ZEL::PObject& request, ZEL::PObject& reply, std::string* error = nullptr);

/// A request about one task.
ZEL::PObject TaskRequest(const char* command, const std::string& task);

/// The daemon's socket, below the root folder when there is one.
std::string DaemonSocket();

}  // namespace zelctl
