#include "programs/zel_server/acceptor.h"

#include <poll.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>

#include "base/child_process.h"
#include "base/text.h"
#include "base/unix_socket.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zel_server/connection_config.h"
#include "programs/zel_server/connections.h"
#include "programs/zel_server/control_messages.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/rsyncd_config.h"
#include "programs/zel_server/space_debts.h"
#include "programs/zel_server/versions_guard.h"

namespace zel_server {

namespace {

using programs::Failure;
using programs::SystemFailure;
using std::chrono::milliseconds;
using std::chrono::seconds;

// More connections than the front ever holds at once.
constexpr int kBacklog = 4096;
// Time between SIGTERM and SIGKILL for a connection that is being ended.
constexpr seconds kEndGrace(5);
// How often processes are looked for that a connection has left behind. A process number is not
// used again within such a time.
constexpr milliseconds kBurialInterval(20);
// Time between the turns in which versions are given up that are older than they are kept.
constexpr std::chrono::hours kKeepInterval(1);
constexpr int kLowestPriority = 19;
// Whoever connects sends the question at once, so the daemon need not wait long for it.
constexpr time_t kQuestionSeconds = 1;

// Listens on a Unix socket at `path`, whose folder nobody else can write to. A socket file left by
// an earlier process is removed. It cannot belong to a running one: the lock in Serve() admits one
// process per server.
base::UniqueFd ListenOn(const std::string& path, int type, mode_t mode) {
    const auto address = base::UnixAddress::Of(path);
    if (!address) {
        throw Failure(path + " is too long for the name of a socket: choose a shorter TARQ_ROOT");
    }
    base::UniqueFd fd(socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    unlink(path.c_str());
    if (!fd || bind(fd.Get(), address->Get(), address->Size()) != 0 ||
        chmod(path.c_str(), mode) != 0 || listen(fd.Get(), kBacklog) != 0) {
        throw SystemFailure("cannot listen on " + path);
    }
    return fd;
}

base::UniqueFd AcceptFrom(const base::UniqueFd& listener, int flags) {
    return base::UniqueFd(accept4(listener.Get(), nullptr, nullptr, SOCK_CLOEXEC | flags));
}

// Reports an error in the form of the rsync daemon, which the client's rsync understands.
void Refuse(const base::UniqueFd& client, const std::string& why) {
    const std::string text = "@RSYNCD: 31.0 sha512 sha256\n@ERROR: " + why + "\n";
    send(client.Get(), text.data(), text.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
}

// Runs in the child process: like inetd, passes the connection to the daemon as standard input.
[[noreturn]] void BecomeDaemon(const base::UniqueFd& client, const std::string& guard,
                               pid_t parent) {
    base::ResetSignals();
    setsid();  // a process group of its own, so that it can be ended as a whole
    const std::string config = WriteConnectionConfig();
    if (config.empty()) {
        perror("zel_server: the configuration of a connection cannot be written");
        Refuse(client, "the server cannot write its configuration");
    } else if (base::EndWithParent(parent) && dup2(client.Get(), STDIN_FILENO) >= 0 &&
               dup2(client.Get(), STDOUT_FILENO) >= 0 &&
               setenv("LD_PRELOAD", guard.c_str(), 1) == 0 &&
               setenv(kConnectionVariable, std::to_string(getpid()).c_str(), 1) == 0) {
        execlp("rsync", "rsync", "--daemon", ("--config=" + config).c_str(), nullptr);
        perror("zel_server: rsync cannot be run");
    }
    _exit(127);
}

}  // namespace

Acceptor::Acceptor(uid_t front_user)
    : front_user_(front_user),
      connections_fd_(ListenOn(FrontSocket(), SOCK_STREAM, 0666)),
      control_fd_(ListenOn(ControlSocket(), SOCK_SEQPACKET, 0600)),
      guard_(VersionsGuard()) {
    sigset_t signals;
    sigemptyset(&signals);
    for (const int number : {SIGCHLD, SIGTERM, SIGINT}) {
        sigaddset(&signals, number);
    }
    signals_fd_ = base::UniqueFd(signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
    if (!signals_fd_) {
        throw SystemFailure("cannot watch for signals");
    }
}

Acceptor::~Acceptor() {
    EndAll();
    unlink(FrontSocket().c_str());
    unlink(ControlSocket().c_str());
}

std::optional<int> Acceptor::Run(pid_t guarded) {
    for (;;) {
        pollfd fds[] = {{connections_fd_.Get(), POLLIN, 0},
                        {control_fd_.Get(), POLLIN, 0},
                        {signals_fd_.Get(), POLLIN, 0}};
        if (poll(fds, 3, MillisecondsToWait()) < 0 && errno != EINTR) {
            throw SystemFailure("cannot wait for connections");
        }
        signalfd_siginfo signal = {};
        while (read(signals_fd_.Get(), &signal, sizeof signal) == sizeof signal) {
            if (signal.ssi_signo != SIGCHLD) {
                return std::nullopt;
            }
        }
        if (const auto status = Reap(guarded)) {
            return status;
        }
        // Log-ins first: a connection that has just logged in must not be ended to make room.
        Answer();
        Accept();
        EndLate();
        ForgetBuried();
        KeepVersionsWhenDue();
    }
}

void Acceptor::Accept() {
    base::UniqueFd client = AcceptFrom(connections_fd_, 0);
    if (!client) {
        return;
    }
    const auto peer = base::PeerOf(client.Get());
    if (!peer || (peer->uid != 0 && peer->uid != geteuid() && peer->uid != front_user_)) {
        return;
    }
    // Connections that are being ended count as well: their processes still exist.
    if (connections_.size() - Waiting() >= kMaxConnections) {
        Refuse(client, "max connections (" + std::to_string(kMaxConnections) +
                           ") reached -- try again later");
        return;
    }
    if (Waiting() >= kMaxWaiting) {
        EndOldestWaiting();
    }
    StartDaemon(std::move(client));
}

void Acceptor::StartDaemon(base::UniqueFd client) {
    const pid_t parent = getpid();
    const pid_t child = fork();
    if (child == 0) {
        BecomeDaemon(client, guard_, parent);
    }
    if (child < 0) {
        Refuse(client, "the server cannot start a process -- try again later");
        return;
    }
    connections_[child] = Connection();  // of that number, there may be one whose group has ended
}

// In a process of its own, behind everything else that the machine does.
void Acceptor::KeepVersionsWhenDue() {
    const bool all = Clock::now() >= keep_at_;
    if (keeper_ != 0 || (!all && !space_is_due_)) {
        return;
    }
    if (all) {
        keep_at_ = Clock::now() + kKeepInterval;
    }
    space_is_due_ = false;
    const pid_t parent = getpid();
    const pid_t child = fork();
    if (child == 0) {
        base::ResetSignals();
        setpriority(PRIO_PROCESS, 0, kLowestPriority);
        if (base::EndWithParent(parent)) {
            execl("/proc/self/exe", "zel_server", "keep-versions", all ? nullptr : "--space",
                  nullptr);
        }
        _exit(127);
    }
    keeper_ = std::max(child, 0);
}

void Acceptor::Answer() {
    while (const base::UniqueFd asker = AcceptFrom(control_fd_, 0)) {
        const auto peer = base::PeerOf(asker.Get());
        const timeval limit = {kQuestionSeconds, 0};
        char question[kMaxControlMessage];
        if (!peer || (peer->uid != 0 && peer->uid != geteuid()) ||
            setsockopt(asker.Get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit) != 0) {
            continue;
        }
        const ssize_t size = recv(asker.Get(), question, sizeof question, 0);
        if (size > 0) {
            const std::string answer = AnswerTo(std::string(question, static_cast<size_t>(size)));
            send(asker.Get(), answer.data(), answer.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        }
    }
}

std::string Acceptor::AnswerTo(const std::string& question) {
    const size_t blank = question.find(' ');
    const std::string word = question.substr(0, blank);
    const std::string rest = blank == std::string::npos ? "" : question.substr(blank + 1);
    return rest.empty()      ? "unknown"
           : word == "login" ? LogIn(rest)
           : word == "end"   ? End(rest)
                             : "unknown";
}

std::string Acceptor::LogIn(const std::string& rest) {
    const size_t blank = std::min(rest.find(' '), rest.size() - 1);
    const auto process = base::ParseNumber(rest.substr(0, blank), INT32_MAX);
    const std::string account = rest.substr(blank + 1);
    const auto found = connections_.find(static_cast<pid_t>(process.value_or(0)));
    if (found == connections_.end() || found->second.ending || !IsAccountName(account)) {
        return kNotServed;
    }
    const auto count = std::count_if(connections_.begin(), connections_.end(), [&](const auto& c) {
        return c.second.account == account && !c.second.ending;
    });
    if (found->second.account.empty() && static_cast<size_t>(count) >= kMaxAccountConnections) {
        return kTooMany;
    }
    found->second.account = account;
    return kAdmitted;
}

std::string Acceptor::End(const std::string& account) {
    size_t count = 0;
    for (auto& connection : connections_) {
        if (!account.empty() && connection.second.account == account) {
            End(connection.first, connection.second);
            ++count;
        }
    }
    return std::to_string(count);
}

void Acceptor::End(pid_t process, Connection& connection) {
    if (!connection.ending) {
        connection.ending = true;
        connection.since = Clock::now();
        kill(-process, SIGTERM);
    }
}

void Acceptor::EndOldestWaiting() {
    auto oldest = connections_.end();
    for (auto next = connections_.begin(); next != connections_.end(); ++next) {
        const bool waits = next->second.account.empty() && !next->second.ending;
        if (waits && (oldest == connections_.end() || next->second.since < oldest->second.since)) {
            oldest = next;
        }
    }
    if (oldest != connections_.end()) {
        End(oldest->first, oldest->second);
    }
}

// Ends connections that did not log in in time, and kills those that did not end in time.
void Acceptor::EndLate() {
    const Clock::time_point now = Clock::now();
    for (auto& [process, connection] : connections_) {
        if (connection.ending && now - connection.since > kEndGrace) {
            kill(-process, SIGKILL);
        } else if (connection.account.empty() && now - connection.since > seconds(kLoginSeconds)) {
            End(process, connection);
        }
    }
}

// Reaps ended children. Returns the wait status of `guarded` once that has ended.
std::optional<int> Acceptor::Reap(pid_t guarded) {
    siginfo_t ended = {};
    while (waitid(P_ALL, 0, &ended, WEXITED | WNOHANG | WNOWAIT) == 0 && ended.si_pid != 0) {
        if (ended.si_pid == keeper_) {
            keeper_ = 0;
        }
        int status = 0;
        waitpid(ended.si_pid, &status, 0);
        const auto connection = connections_.find(ended.si_pid);
        if (connection != connections_.end()) {
            space_is_due_ = space_is_due_ || IsSpaceDue();
            connection->second.leaderless = true;
            RemoveConnectionConfig(ended.si_pid);
            // As long as there is one process in the group, nobody else gets its number.
            if (kill(-ended.si_pid, 0) == 0) {
                End(ended.si_pid, connection->second);
            } else {
                connections_.erase(connection);
            }
        }
        if (ended.si_pid == guarded) {
            return status;
        }
        ended = {};
    }
    return std::nullopt;
}

// A receiver of rsync's may outlive the process that has started it by ten minutes, SIGTERM or not,
// and would go on writing.
void Acceptor::ForgetBuried() {
    for (auto next = connections_.begin(); next != connections_.end();) {
        const bool buried = next->second.leaderless && kill(-next->first, 0) != 0;
        next = buried ? connections_.erase(next) : std::next(next);
    }
}

void Acceptor::EndAll() {
    for (const auto& connection : connections_) {
        kill(-connection.first, SIGTERM);
    }
    const Clock::time_point limit = Clock::now() + kEndGrace;
    while (!connections_.empty() && Clock::now() < limit) {
        Reap(0);
        ForgetBuried();
        usleep(10000);
    }
    for (const auto& connection : connections_) {
        kill(-connection.first, SIGKILL);
    }
}

size_t Acceptor::Waiting() const {
    return static_cast<size_t>(
        std::count_if(connections_.begin(), connections_.end(), [](const auto& connection) {
            return connection.second.account.empty() && !connection.second.ending;
        }));
}

// The time until the next deadline; -1 when there is none but the end of the keeper.
int Acceptor::MillisecondsToWait() const {
    std::optional<Clock::time_point> first;
    if (keeper_ == 0) {
        first = keep_at_;
    }
    for (const auto& entry : connections_) {
        const Connection& connection = entry.second;
        if (connection.leaderless) {
            const Clock::time_point again = Clock::now() + kBurialInterval;
            first = first ? std::min(*first, again) : again;
        } else if (connection.ending || connection.account.empty()) {
            const Clock::time_point late =
                connection.since + (connection.ending ? kEndGrace : seconds(kLoginSeconds));
            first = first ? std::min(*first, late) : late;
        }
    }
    if (!first) {
        return -1;
    }
    const auto left = std::chrono::duration_cast<milliseconds>(*first - Clock::now()).count();
    return static_cast<int>(std::max<decltype(left)>(left, 0) + 1);
}

}  // namespace zel_server
