// The daemon as people run it: a process of its own on a root folder, asked through its socket.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "tests/integration/servers.h"

namespace test {

/// A request without keys of its own; `task`: the one that it is about, if any.
ZEL::PObject Request(const char* command, const std::string& task = "");

/// Ended with SIGKILL when destroyed or when the test dies.
class DaemonProcess {
public:
    /// `root`: its root folder. `log`: what it writes, appended.
    DaemonProcess(std::string root, std::string log);
    ~DaemonProcess();
    DaemonProcess(const DaemonProcess&) = delete;
    DaemonProcess& operator=(const DaemonProcess&) = delete;

    /// Starts it and waits until it answers; throws what it said when it ended before. `before`: a
    /// command that becomes the daemon, given as its arguments.
    void Start(std::vector<std::string> before = {});
    void Signal(int number) const;
    /// Sends the signal and waits for the end: the exit code, or -1 when the signal ended it.
    int End(int number);
    pid_t Pid() const { return pid_; }

    /// One request on a connection of its own; throws when no reply comes.
    ZEL::PObject Ask(const ZEL::PObject& request) const;
    ZEL::PObject Ask(const char* command, const std::string& task = "") const;
    std::string Socket() const { return root_ + "/var/run/zel_daemon.sock"; }
    std::string Log() const;

private:
    bool Answers() const;

    const std::string root_;
    const std::string log_;
    pid_t pid_ = -1;
};

}  // namespace test
