// Endpoints over which the service's processes on one host exchange PObjects.
//
//   server: IPCListener listener; listener.prepare("/run/x.sock");
//           while (...) if (listener.isReady()) { IPCSender peer; peer.assign(listener.accept());
//           peer.recv(request); peer.send(reply); }
//   client: IPCSender sender; sender.connect("/run/x.sock"); sender.send(request, true, reply);
//
// Threads: an endpoint belongs to one thread at a time.
#pragma once

#include <sys/time.h>

#include <cstdint>
#include <string>

#include "ZEL/channel.h"
#include "ZEL/pobject.h"

namespace ZEL {

#pragma GCC visibility push(default)

/// The listening side: a loopback TCP port or a unix domain socket. Failures are -1, with the
/// reason in the log.
class IPCListener {
public:
    IPCListener() = default;
    IPCListener(const IPCListener&) = delete;
    IPCListener& operator=(const IPCListener&) = delete;
    /// Closes.
    ~IPCListener();

    /// Listens on 127.0.0.1, on the first free port at or above `port`, in place of whatever it
    /// listened on. 0: any free port. The port, or -1.
    int prepare(int port);
    /// Listens at a path, where it replaces whatever file is there. 0, or -1, also while it is
    /// listening already.
    int prepare(const std::string& path);

    /// How long isReady() waits; 3 s unless set.
    void setTimeout(const timeval& timeout) {
        timeout_seconds_ = timeout.tv_sec;
        timeout_microseconds_ = timeout.tv_usec;
    }
    /// Whether a connection can be accepted, waiting for one for the time-out. A signal ends the
    /// wait early.
    bool isReady();
    /// The next connection, which the caller owns, or -1. Waits for one.
    int accept();
    /// The listening socket, still the listener's, or -1.
    int getFD() const { return fd_; }
    /// Stops listening and removes the socket file.
    void close();

    // The steps of the operations above.

    /// Binds to the first free port at or above `port`. The port, or -1.
    int do_bind(int fd, int port);
    /// Make a listening socket, on exactly that port of 127.0.0.1 (1 to 65535) or at that path. Its
    /// descriptor, which the caller owns, or -1.
    int OpenSocket(int port);
    int OpenDomainSocket(const std::string& path);
    /// Close a listening socket; the second also removes its socket file. 0, or -1 when fd is not a
    /// descriptor.
    int CloseSocket(int fd);
    int CloseDomainSocket(int fd);

private:
    // No timeval: its size is the program's time_t's.
    int64_t timeout_seconds_ = 3;
    int64_t timeout_microseconds_ = 0;
    int fd_ = -1;       // the listening socket
    std::string path_;  // of the domain socket; empty: TCP
};

/// A connected side. Failures are -1, with the reason in the log: close it then.
class IPCSender {
public:
    IPCSender();
    IPCSender(const IPCSender&) = delete;
    IPCSender& operator=(const IPCSender&) = delete;
    /// Closes.
    virtual ~IPCSender();

    /// Connect to the listener at a path, or on a port of 127.0.0.1.
    int connect(const std::string& path);
    int connect(int port);
    /// Takes over a connection that a listener accepted: it is the sender's from a result of 0 on.
    int assign(int fd);

    // The order of the virtual operations is part of the binary interface.

    /// Sends a request and, when asked to, waits for the reply. Without progress it gives up after
    /// 60 s.
    virtual int send(const PObject& request, bool want_reply, PObject& reply);
    virtual int send(const PObject& request);
    /// Receives one value. `value` keeps what it holds already, see PStream::Recv(): pass a fresh
    /// one.
    virtual int recv(PObject& value);

    void close();

private:
    Channel channel_;
};

#pragma GCC visibility pop

}  // namespace ZEL
