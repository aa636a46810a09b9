#include "programs/zelctl/base/daemon_client.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "ZEL/stream.h"
#include "base/unique_fd.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/interrupt.h"
#include "tarq/root_path.h"

namespace zelctl {

namespace {

constexpr char kSocket[] = "/var/run/zel_daemon.sock";
constexpr unsigned int kRingBytes = 81920;
constexpr size_t kMaxString = 65535;  // a string's length has 16 bits on the wire
// A daemon that hangs with a full queue of connections would keep connect() waiting for ever.
constexpr timeval kConnectLimit = {10, 0};

// The key under which a string is too long for the wire; empty when none is.
std::string TooLong(const ZEL::PObject& value, const std::string& key) {
    if (value.isString() && value.asString().size() > kMaxString) {
        return key;
    }
    for (const ZEL::PObject& element : value.asArray()) {
        std::string found = TooLong(element, key);
        if (!found.empty()) {
            return found;
        }
    }
    for (const auto& [name, element] : value.asMap()) {
        std::string found = TooLong(element, name);
        if (!found.empty()) {
            return found;
        }
    }
    return "";
}

ExitCode CodeOfResult(int result) {
    return result == ZEL::RESULT_INVALID_ARGUMENT ? kUsage : kLocal;
}

}  // namespace

std::string DaemonSocket() {
    return TARQ::RootPath(kSocket);
}

DaemonConnection::DaemonConnection() : channel_(kRingBytes) {
    channel_.SetFlag(InterruptFlag());
}

ExitCode DaemonConnection::Tell(ExitCode code) const {
    return error_.empty() ? code : Fail(code, "%s", error_.c_str());
}

ExitCode DaemonConnection::Failed(ExitCode code, const std::string& error) {
    error_ = programs::Printable(error);
    return code;
}

ExitCode DaemonConnection::CannotConnect(const std::string& path, int error) {
    fault_ = DaemonFault::kOther;
    switch (error) {
        case ENOENT:
        case ECONNREFUSED:
            fault_ = DaemonFault::kNotRunning;
            return Failed(kLocal, "the daemon is not running: systemctl start zel_daemon");
        case EACCES:
        case EPERM:
            fault_ = DaemonFault::kNotPermitted;
            return Failed(kLocal, "not permitted to use the daemon's socket " + path +
                                      ": be root, or a member of its group (key 'group' of "
                                      "zel_daemon.conf)");
        case EAGAIN:
            fault_ = DaemonFault::kSilent;
            return Failed(kLocal, "the daemon does not answer: systemctl restart zel_daemon");
        default:
            return Failed(kLocal, "cannot reach the daemon at " + path + ": " + strerror(error));
    }
}

ExitCode DaemonConnection::Connect() {
    const std::string path = DaemonSocket();
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        return CannotConnect(path, ENAMETOOLONG);
    }
    memcpy(address.sun_path, path.data(), path.size());
    base::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd ||
        setsockopt(fd.Get(), SOL_SOCKET, SO_SNDTIMEO, &kConnectLimit, sizeof kConnectLimit) != 0 ||
        connect(fd.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        return CannotConnect(path, errno);
    }
    if (channel_.Open(fd.Get(), true) != ZEL::RESULT_SUCCESS) {
        return CannotConnect(path, errno);
    }
    fd.Release();  // the channel's now
    return kOk;
}

ExitCode DaemonConnection::Lost() {
    fault_ = DaemonFault::kSilent;
    return Failed(Interrupted() ? kCancelled : kLocal,
                  Interrupted()
                      ? ""
                      : "the daemon has broken off: see 'systemctl status zel_daemon' and its log");
}

ExitCode DaemonConnection::Send(const ZEL::PObject& request) {
    const std::string key = TooLong(request, "request");
    if (!key.empty()) {
        return Failed(kUsage,
                      "the value for '" + key + "' is too long: a text has at most 65535 bytes");
    }
    ZEL::PStream stream;
    return stream.Send(channel_, request) == ZEL::RESULT_SUCCESS ? kOk : Lost();
}

ExitCode DaemonConnection::Receive(ZEL::PObject& reply) {
    reply.clear();
    ZEL::PStream stream;
    if (stream.Recv(channel_, reply) != ZEL::RESULT_SUCCESS) {
        return Lost();
    }
    const ZEL::PObject& received = reply;
    if (!received["result"].isInteger()) {
        return Failed(kLocal,
                      "the daemon's answer is no reply: are zelctl and zel_daemon of one version?");
    }
    const int result = received["result"].asInt32();
    if (result == ZEL::RESULT_SUCCESS) {
        return kOk;
    }
    if (result == ZEL::RESULT_NO_PERMISSION) {
        fault_ = DaemonFault::kNotPermitted;
    }
    const std::string error = received["error"].asString();
    return Failed(
        CodeOfResult(result),
        error.empty() ? "the daemon refuses (result " + std::to_string(result) + ")" : error);
}

ExitCode AskDaemon(const ZEL::PObject& request, ZEL::PObject& reply, std::string* error) {
    DaemonConnection connection;
    ExitCode code = connection.Connect();
    if (code == kOk) {
        code = connection.Send(request);
    }
    if (code == kOk) {
        code = connection.Receive(reply);
    }
    if (error != nullptr) {
        *error = connection.Error();
        return code;
    }
    return connection.Tell(code);
}

ZEL::PObject TaskRequest(const char* command, const std::string& task) {
    ZEL::PObject request;
    request["command"] = command;
    request["task"] = task;
    return request;
}

}  // namespace zelctl
