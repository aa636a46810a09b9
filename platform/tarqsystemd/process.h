// A process that is known by its number and the time it started at, so that another one that got
// its number later is never taken for it.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "base/unique_fd.h"

namespace tarq_systemd {

struct ProcessId {
    pid_t pid = 0;
    unsigned long long start_time = 0;  ///< clock ticks since the machine's start
};

/// The process that has the number `pid` now; nothing when there is none or it has ended and waits
/// to be collected.
std::optional<ProcessId> LookUpProcess(pid_t pid);

/// A handle on a running process: signals reach that process or none.
class Process {
public:
    /// Nothing when the process has ended.
    static std::optional<Process> Open(const ProcessId& id);

    /// False, with errno set, when the signal cannot be sent. A process that has ended is no
    /// failure.
    bool Signal(int number) const;
    /// Sends SIGKILL to the process and to the others of its process group.
    bool KillGroup() const;
    /// Waits until the process has ended; false when it has not within `limit`.
    bool WaitForEnd(std::chrono::milliseconds limit) const;

private:
    Process(pid_t pid, base::UniqueFd handle) : pid_(pid), handle_(std::move(handle)) {}

    pid_t pid_;
    base::UniqueFd handle_;
};

/// Splits a command into words at blanks; what stands in single or double quotes is taken as it
/// stands. Nothing when a quote is not closed.
std::optional<std::vector<std::string>> SplitCommand(const std::string& command);

/// A process that has been made in the background (a session and a process group of its own, input
/// and output from and to nowhere, no open files of the caller's) and waits for Release() before it
/// becomes the command. Destroyed without, it ends.
class BackgroundLaunch {
public:
    /// `words`: an absolute program path and its arguments. Nothing, with errno set, when no
    /// process can be made.
    static std::optional<BackgroundLaunch> Prepare(const std::vector<std::string>& words);

    const ProcessId& Id() const { return id_; }
    /// Lets the process run the command. False, with errno set, when the command cannot be run.
    bool Release();

private:
    BackgroundLaunch(ProcessId id, base::UniqueFd link) : id_(id), link_(std::move(link)) {}

    ProcessId id_;
    base::UniqueFd link_;  ///< to the waiting process; its end closes when the command runs
};

}  // namespace tarq_systemd
