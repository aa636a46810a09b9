#include "programs/zel_server/serve.h"

#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>

#include "base/child_process.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zel_server/rsyncd_config.h"

namespace zel_server {

namespace {

constexpr char kLoopback[] = "127.0.0.1";
constexpr size_t kMaxCommandLine = 4096;

// The daemon's configuration names one address and one pid file: the second daemon has its own.
std::vector<std::string> DaemonCommand(const std::string& address, bool first) {
    std::vector<std::string> command = {"rsync", "--daemon", "--no-detach",
                                        "--config=" + RsyncdConfig()};
    if (!first) {
        command.push_back("--address=" + address);
        command.push_back("--dparam=pidfile=" + AnswerFolder() + "/.second.pid");
    }
    return command;
}

// Becomes the daemon; comes back, with errno set, only when it cannot.
void Become(const std::vector<std::string>& command) {
    const std::vector<char*> arguments = base::ArgumentVector(command);
    execvp(arguments[0], arguments.data());
}

// The daemon ends with this process, however that ends.
pid_t StartDaemon(const std::vector<std::string>& command) {
    const pid_t parent = getpid();
    const pid_t child = fork();
    if (child != 0) {
        return child;
    }
    if (prctl(PR_SET_PDEATHSIG, SIGTERM) == 0 && getppid() == parent) {
        Become(command);
        perror("zel_server: rsync cannot be run");
    }
    _exit(127);
}

[[noreturn]] void WaitForFirstEnd(const std::vector<pid_t>& daemons) {
    int status = 0;
    pid_t ended = 0;
    do {
        ended = waitpid(-1, &status, 0);
    } while (ended < 0 && errno == EINTR);
    for (const pid_t daemon : daemons) {
        if (daemon != ended) {
            kill(daemon, SIGTERM);
            waitpid(daemon, nullptr, 0);
        }
    }
    // Nobody has told this process to end: that is a failure whatever the daemon says.
    throw programs::Failure("the rsync daemon has ended" +
                            (WIFSIGNALED(status)
                                 ? " by signal " + std::to_string(WTERMSIG(status))
                                 : " with status " + std::to_string(WEXITSTATUS(status))));
}

}  // namespace

std::vector<std::string> ServedAddresses(const ServerConfig& config) {
    std::vector<std::string> served = {config.address};
    const std::vector<std::string> numbers = NumericAddresses(config.address);
    const auto has = [&](const char* number) {
        return std::find(numbers.begin(), numbers.end(), number) != numbers.end();
    };
    if (!has("0.0.0.0") && !has(kLoopback)) {
        served.emplace_back(kLoopback);
    }
    return served;
}

bool IsOurDaemon(pid_t pid) {
    const auto words = base::ReadFile("/proc/" + std::to_string(pid) + "/cmdline", kMaxCommandLine);
    if (!words) {
        return false;
    }
    // As one word, or as two.
    const std::string file = RsyncdConfig() + '\0';
    return words->find('\0' + ("--config=" + file)) != std::string::npos ||
           words->find('\0' + (("--config" + std::string(1, '\0')) + file)) != std::string::npos;
}

bool ServesAll(const ServerConfig& config, const std::vector<Listener>& listeners) {
    for (const std::string& address : ServedAddresses(config)) {
        const std::vector<std::string> numbers = NumericAddresses(address);
        const bool served =
            std::any_of(listeners.begin(), listeners.end(), [&](const Listener& listener) {
                return IsOurDaemon(listener.pid) &&
                       std::find(numbers.begin(), numbers.end(), listener.address) != numbers.end();
            });
        if (!served) {
            return false;
        }
    }
    return true;
}

void Serve() {
    // Of another kind: starting it again does not help.
    const ServerConfig config = RequireServerConfig(programs::FailureKind::kUsage);
    const std::vector<std::string> addresses = ServedAddresses(config);
    if (addresses.size() == 1) {
        Become(DaemonCommand(addresses[0], true));
        throw programs::SystemFailure("rsync cannot be run");
    }
    std::vector<pid_t> daemons;
    for (const std::string& address : addresses) {
        const pid_t daemon = StartDaemon(DaemonCommand(address, daemons.empty()));
        if (daemon < 0) {
            throw programs::SystemFailure("cannot start the rsync daemon");
        }
        daemons.push_back(daemon);
    }
    WaitForFirstEnd(daemons);
}

}  // namespace zel_server
