#include "programs/zelctl/base/daemon_client.h"

#include <sys/socket.h>
#include <sys/time.h>

#include <cerrno>
#include <cstring>

#include "ZEL/stream.h"
#include "base/unique_fd.h"
#include "base/unix_socket.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/common/wire_text.h"
#include "programs/zelctl/base/interrupt.h"
#include "tarq/root_path.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;

constexpr char kSocket[] = "/var/run/zel_daemon.sock";
constexpr unsigned int kRingBytes = 81920;
// Without a limit, connect() blocks forever when the daemon hangs and its backlog is full.
constexpr timeval kConnectLimit = {10, 0};

}  // namespace

std::string DaemonSocket() {
    return TARQ::RootPath(kSocket);
}

DaemonConnection::DaemonConnection() : channel_(kRingBytes) {
    channel_.SetFlag(InterruptFlag());
}

Failure DaemonConnection::CannotConnect(const std::string& path, int error) {
    const auto failed = [this](DaemonFault fault, const std::string& text) {
        fault_ = fault;
        return Failure(FailureKind::kLocal, programs::Printable(text));
    };
    switch (error) {
        case ENOENT:
        case ECONNREFUSED:
            return failed(DaemonFault::kNotRunning,
                          "the daemon is not running: systemctl start zel_daemon");
        case EACCES:
        case EPERM:
            return failed(DaemonFault::kNotPermitted,
                          "not permitted to use the daemon's socket " + path +
                              ": be root, or a member of its group (key 'group' of "
                              "zel_daemon.conf)");
        case EAGAIN:
            return failed(DaemonFault::kSilent,
                          "the daemon does not answer: systemctl restart zel_daemon");
        default:
            return failed(DaemonFault::kOther,
                          "cannot reach the daemon at " + path + ": " + strerror(error));
    }
}

void DaemonConnection::Connect() {
    const std::string path = DaemonSocket();
    const auto address = base::UnixAddress::Of(path);
    if (!address) {
        throw CannotConnect(path, ENAMETOOLONG);
    }
    base::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd ||
        setsockopt(fd.Get(), SOL_SOCKET, SO_SNDTIMEO, &kConnectLimit, sizeof kConnectLimit) != 0 ||
        connect(fd.Get(), address->Get(), address->Size()) != 0 ||
        channel_.Open(fd.Get(), true) != ZEL::RESULT_SUCCESS) {
        throw CannotConnect(path, errno);
    }
    fd.Release();  // the channel owns it now
}

Failure DaemonConnection::Lost() {
    fault_ = DaemonFault::kSilent;
    return Interrupted()
               ? programs::ReportedFailure(FailureKind::kCancelled)
               : Failure(FailureKind::kLocal,
                         "the daemon has broken off: see 'systemctl status zel_daemon' and its "
                         "log");
}

void DaemonConnection::Send(const ZEL::PObject& request) {
    const std::string key = programs::KeyOfTooLong(request, "request");
    if (!key.empty()) {
        throw Failure(FailureKind::kUsage,
                      programs::Printable("the value for '" + key +
                                          "' is too long: a text has at most 65535 bytes"));
    }
    ZEL::PStream stream;
    if (stream.Send(channel_, request) != ZEL::RESULT_SUCCESS) {
        throw Lost();
    }
}

ZEL::PObject DaemonConnection::Receive() {
    ZEL::PObject reply;
    ZEL::PStream stream;
    if (stream.Recv(channel_, reply) != ZEL::RESULT_SUCCESS) {
        throw Lost();
    }
    const ZEL::PObject& received = reply;
    if (!received["result"].isInteger()) {
        throw Failure(FailureKind::kLocal,
                      "the daemon's answer is no reply: are zelctl and zel_daemon of one version?");
    }
    const int result = received["result"].asInt32();
    if (result == ZEL::RESULT_SUCCESS) {
        return reply;
    }
    if (result == ZEL::RESULT_NO_PERMISSION) {
        fault_ = DaemonFault::kNotPermitted;
    }
    const std::string error = programs::Printable(received["error"].asString());
    throw Failure(
        result == ZEL::RESULT_INVALID_ARGUMENT ? FailureKind::kUsage : FailureKind::kLocal,
        error.empty() ? "the daemon refuses (result " + std::to_string(result) + ")" : error,
        result);
}

ZEL::PObject AskDaemon(const ZEL::PObject& request) {
    DaemonConnection connection;
    connection.Connect();
    connection.Send(request);
    return connection.Receive();
}

std::optional<ZEL::PObject> TryToAskDaemon(const ZEL::PObject& request) {
    try {
        return AskDaemon(request);
    } catch (const Failure&) {
        return std::nullopt;
    }
}

ZEL::PObject TaskRequest(const char* command, const std::string& task) {
    ZEL::PObject request;
    request["command"] = command;
    request["task"] = task;
    return request;
}

}  // namespace zelctl
