#include "platform/tarqsystemd/process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

extern "C" {  // the header has no such thing of its own
#include <sys/pidfd.h>
}

#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <sstream>
#include <utility>

#include "base/child_process.h"
#include "base/whole_file.h"

namespace tarq_systemd {
namespace {

using base::UniqueFd;
using std::chrono::duration_cast;
using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr int kStartTimeField = 22;  // of /proc/<pid>/stat, counted from 1
constexpr int kLinkFd = 3;  // in the background process: the first after the standard streams

/// Reads one value from a seqpacket socket: 1, 0 when the other end is closed, or -1 with errno
/// set.
template <typename Value>
int Receive(int fd, Value* value) {
    for (;;) {
        const ssize_t got = recv(fd, value, sizeof *value, 0);
        if (got >= 0) {
            return got == sizeof *value ? 1 : 0;
        }
        if (errno != EINTR) {
            return -1;
        }
    }
}

template <typename Value>
bool Send(int fd, const Value& value) {
    return send(fd, &value, sizeof value, MSG_NOSIGNAL) == sizeof value;
}

/// Between fork and exec: nothing here may allocate or take a lock, for other threads may have held
/// one.
[[noreturn]] void BecomeCommand(int link, char* const* arguments) {
    if (dup2(link, kLinkFd) < 0 || fcntl(kLinkFd, F_SETFD, FD_CLOEXEC) != 0) {
        _exit(EXIT_FAILURE);
    }
    const int nowhere = open("/dev/null", O_RDWR);
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) {
        if (nowhere < 0 || dup2(nowhere, fd) < 0) {
            _exit(EXIT_FAILURE);
        }
    }
    closefrom(kLinkFd + 1);

    // The command must not inherit the caller's ignored and blocked signals.
    base::ResetSignals();

    const pid_t self = getpid();
    char go = 0;
    if (setpgid(0, 0) != 0 || chdir("/") != 0 || !Send(kLinkFd, self) ||
        Receive(kLinkFd, &go) != 1) {
        _exit(EXIT_FAILURE);
    }
    execv(arguments[0], arguments);
    Send(kLinkFd, errno);
    _exit(EXIT_FAILURE);
}

bool WaitForChild(pid_t child) {
    int status = 0;
    pid_t waited = 0;
    do {
        waited = waitpid(child, &status, 0);
    } while (waited < 0 && errno == EINTR);
    // A caller that ignores SIGCHLD has the child collected by the kernel.
    return waited < 0 ? errno == ECHILD : status == 0;
}

}  // namespace

std::optional<ProcessId> LookUpProcess(pid_t pid) {
    const auto text = base::ReadFile("/proc/" + std::to_string(pid) + "/stat");
    // The second field, the program's name in brackets, may hold blanks and brackets itself.
    const size_t name_end = text ? text->rfind(')') : std::string::npos;
    if (name_end == std::string::npos) {
        return std::nullopt;
    }
    std::istringstream fields(text->substr(name_end + 1));
    std::string state;
    fields >> state;
    std::string skipped;
    for (int field = 4; field < kStartTimeField; ++field) {
        fields >> skipped;
    }
    ProcessId id;
    id.pid = pid;
    if (!(fields >> id.start_time) || state == "Z" || state == "X") {
        return std::nullopt;
    }
    return id;
}

std::optional<Process> Process::Open(const ProcessId& id) {
    if (id.pid <= 0) {
        return std::nullopt;
    }
    // The handle comes first: a process that still has the number afterwards is the handle's.
    UniqueFd handle(pidfd_open(id.pid, 0));
    const std::optional<ProcessId> now = LookUpProcess(id.pid);
    if (!handle || !now || now->start_time != id.start_time) {
        return std::nullopt;
    }
    return Process(id.pid, std::move(handle));
}

bool Process::Signal(int number) const {
    return pidfd_send_signal(handle_.Get(), number, nullptr, 0) == 0 || errno == ESRCH;
}

bool Process::KillGroup() const {
    // A group can only be signalled by its number. While the process is stopped it cannot end, so
    // that the number cannot be reused.
    if (!Signal(SIGSTOP)) {
        return false;
    }
    if (!WaitForEnd(milliseconds(0)) && getpgid(pid_) == pid_) {
        kill(-pid_, SIGKILL);
    }
    return Signal(SIGKILL);
}

bool Process::WaitForEnd(milliseconds limit) const {
    const auto deadline = steady_clock::now() + limit;
    for (;;) {
        const auto left = duration_cast<milliseconds>(deadline - steady_clock::now()).count();
        pollfd end = {handle_.Get(), POLLIN, 0};
        const int ready = poll(&end, 1,
                               left <= 0        ? 0
                               : left > INT_MAX ? INT_MAX
                                                : static_cast<int>(left));
        if (ready > 0) {
            return true;
        }
        if ((ready < 0 && errno != EINTR) || left <= 0) {
            return false;
        }
    }
}

std::optional<std::vector<std::string>> SplitCommand(const std::string& command) {
    std::vector<std::string> words;
    std::string word;
    bool in_word = false;
    char quote = '\0';
    for (const char c : command) {
        if (quote != '\0') {
            if (c == quote) {
                quote = '\0';
            } else {
                word += c;
            }
        } else if (c == '\'' || c == '"') {
            quote = c;
            in_word = true;
        } else if (c != ' ' && c != '\t') {
            word += c;
            in_word = true;
        } else if (in_word) {
            words.push_back(std::exchange(word, {}));
            in_word = false;
        }
    }
    if (in_word) {
        words.push_back(word);
    }
    if (quote != '\0') {
        return std::nullopt;
    }
    return words;
}

std::optional<BackgroundLaunch> BackgroundLaunch::Prepare(const std::vector<std::string>& words) {
    std::array<int, 2> ends;
    if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()) != 0) {
        return std::nullopt;
    }
    UniqueFd mine(ends[0]);
    UniqueFd other(ends[1]);
    const std::vector<char*> arguments = base::ArgumentVector(words);

    // The intermediate process ends at once, so that the command is not a child of the caller.
    const pid_t between = fork();
    if (between == 0) {
        setsid();
        const pid_t command = fork();
        if (command == 0) {
            BecomeCommand(other.Get(), arguments.data());
        }
        _exit(command < 0 ? EXIT_FAILURE : EXIT_SUCCESS);
    }
    other.Reset();
    if (between < 0) {
        return std::nullopt;
    }
    pid_t pid = 0;
    if (!WaitForChild(between) || Receive(mine.Get(), &pid) != 1) {
        errno = EAGAIN;
        return std::nullopt;
    }
    const std::optional<ProcessId> id = LookUpProcess(pid);
    if (!id) {
        errno = ESRCH;
        return std::nullopt;
    }
    return BackgroundLaunch(*id, std::move(mine));
}

bool BackgroundLaunch::Release() {
    const char go = 1;
    int error = 0;
    if (!Send(link_.Get(), go)) {
        return false;
    }
    const int received = Receive(link_.Get(), &error);
    if (received == 1) {
        errno = error;
    }
    return received == 0;
}

}  // namespace tarq_systemd
