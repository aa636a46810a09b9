// Talking to the daemon: requests and replies of docs/daemon-protocol.md.
#pragma once

#include <string>

#include "ZEL/channel.h"
#include "ZEL/pobject.h"
#include "programs/zelctl/exit_codes.h"

namespace zelctl {

/// A connection to the daemon. Whatever fails has been told to the person when an operation gives
/// another code than kOk; kCancelled, when WatchForInterrupt() has noted an interrupt, tells
/// nothing. Close it then, by destroying it.
///
/// Threads: one thread.
class DaemonConnection {
public:
    DaemonConnection();

    ExitCode Connect();
    ExitCode Send(const ZEL::PObject& request);
    /// The next reply into `reply`, which is emptied first. An error reply is a failure.
    ExitCode Receive(ZEL::PObject& reply);

private:
    ExitCode Lost() const;

    ZEL::Channel channel_;
};

/// One request and its reply, on a connection of its own.
ExitCode AskDaemon(const ZEL::PObject& request, ZEL::PObject& reply);

/// A request about one task.
ZEL::PObject TaskRequest(const char* command, const std::string& task);

/// The daemon's socket, below the root folder when there is one.
std::string DaemonSocket();

}  // namespace zelctl
