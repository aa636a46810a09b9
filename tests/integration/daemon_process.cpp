#include "tests/integration/daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <stdexcept>
#include <thread>
#include <utility>

#include "ZEL/ipc.h"
#include "tests/support/temp_root.h"

namespace test {

using ZEL::PObject;

PObject Request(const char* command, const std::string& task) {
    PObject request;
    request["command"] = command;
    if (!task.empty()) {
        request["task"] = task;
    }
    return request;
}

DaemonProcess::DaemonProcess(std::string root, std::string log)
    : root_(std::move(root)), log_(std::move(log)) {}

DaemonProcess::~DaemonProcess() {
    End(SIGKILL);
}

void DaemonProcess::Start(std::vector<std::string> before) {
    before.insert(before.end(), {ZEL_DAEMON, "--foreground", "--log", "stderr"});
    std::vector<char*> arguments;
    for (std::string& argument : before) {
        arguments.push_back(argument.data());
    }
    arguments.push_back(nullptr);
    std::string root = "TARQ_ROOT=" + root_;
    std::string path = "PATH=/usr/sbin:/usr/bin:/sbin:/bin";
    char* const environment[] = {root.data(), path.data(), nullptr};
    pid_ = fork();
    if (pid_ == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        const int log = open(log_.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
        dup2(log, STDOUT_FILENO);
        dup2(log, STDERR_FILENO);
        execvpe(arguments[0], arguments.data(), environment);
        _exit(127);
    }
    bool ended = false;
    const bool answered = Await([&] {
        ended = waitpid(pid_, nullptr, WNOHANG) == pid_;
        return ended || Answers();
    });
    if (ended || !answered) {
        pid_ = ended ? -1 : pid_;
        throw std::runtime_error("the daemon does not start: " + Log());
    }
}

bool DaemonProcess::Answers() const {
    // A socket that was left behind is nobody's; the lock's holder makes its own.
    try {
        const PObject reply = Ask("daemon_status");
        return reply["pid"].asInt32() == pid_;
    } catch (const std::runtime_error&) {
        return false;
    }
}

void DaemonProcess::Signal(int number) const {
    if (pid_ > 0) {
        kill(pid_, number);
    }
}

int DaemonProcess::End(int number) {
    int status = 0;
    if (pid_ > 0) {
        Signal(number);
        waitpid(pid_, &status, 0);
        pid_ = -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

PObject DaemonProcess::Ask(const PObject& request) const {
    ZEL::IPCSender sender;
    PObject reply;
    if (sender.connect(Socket()) != 0 || sender.send(request, true, reply) != 0) {
        throw std::runtime_error("the daemon does not answer");
    }
    return reply;
}

PObject DaemonProcess::Ask(const char* command, const std::string& task) const {
    return Ask(Request(command, task));
}

std::string DaemonProcess::Log() const {
    return ReadFile(log_);
}

}  // namespace test
