#include "programs/zel_server/connections.h"

#include <sys/socket.h>
#include <sys/time.h>

#include <cstdlib>

#include "base/text.h"
#include "base/unique_fd.h"
#include "base/unix_socket.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/control_messages.h"
#include "programs/zel_server/server_config.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

// The daemon answers at once.
constexpr time_t kAnswerSeconds = 10;

base::UniqueFd Connect() {
    base::UniqueFd fd(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    const timeval limit = {kAnswerSeconds, 0};
    const auto address = base::UnixAddress::Of(ControlSocket());
    if (!fd || !address || setsockopt(fd.Get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit) ||
        setsockopt(fd.Get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit) ||
        connect(fd.Get(), address->Get(), address->Size()) != 0) {
        return base::UniqueFd();
    }
    return fd;
}

// Empty when there is no answer.
std::string Ask(const std::string& question) {
    const base::UniqueFd fd = Connect();
    char answer[kMaxControlMessage];
    if (!fd || send(fd.Get(), question.data(), question.size(), MSG_NOSIGNAL) < 0) {
        return "";
    }
    const ssize_t size = recv(fd.Get(), answer, sizeof answer, 0);
    return size > 0 ? std::string(answer, static_cast<size_t>(size)) : "";
}

}  // namespace

Admission AdmitConnection() {
    const char* const process = getenv("RSYNC_PID");
    const char* const account = getenv("RSYNC_USER_NAME");
    if (process == nullptr || account == nullptr) {
        return Admission::kNotServed;
    }
    const std::string answer = Ask(std::string("login ") + process + " " + account);
    if (answer == kTooMany) {
        return Admission::kTooMany;
    }
    // If the account was removed just before this log-in was registered, the request to end its
    // connections has missed it: so the account is checked once more.
    return answer == kAdmitted && MayLogIn(account) ? Admission::kAdmitted : Admission::kNotServed;
}

size_t EndConnections(const std::string& account) {
    return static_cast<size_t>(
        base::ParseNumber(Ask("end " + account), kMaxConnections).value_or(0));
}

std::optional<pid_t> ServingProcess() {
    const base::UniqueFd fd = Connect();
    const auto peer = fd ? base::PeerOf(fd.Get()) : std::nullopt;
    return peer ? std::optional<pid_t>(peer->pid) : std::nullopt;
}

std::string FrontSocket() {
    return FrontFolder() + "/rsyncd";
}

// No account has a name that begins with a dot.
std::string ControlSocket() {
    return AnswerFolder() + "/.control";
}

}  // namespace zel_server
