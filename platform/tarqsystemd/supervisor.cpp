#include "platform/tarqsystemd/supervisor.h"

#include <signal.h>
#include <syslog.h>
#include <tarq/core.h>
#include <tarq/root_path.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <optional>
#include <sstream>
#include <vector>

#include "base/file_lock.h"
#include "base/replace_file.h"
#include "base/text.h"
#include "base/whole_file.h"
#include "platform/internal/config.h"
#include "platform/tarqsystemd/process.h"

namespace tarq_systemd {
namespace {

using std::chrono::seconds;
using tarq_internal::ReadResult;

constexpr char kConfiguration[] = "/usr/tarq/etc/tarqsystemd.conf";
constexpr char kRunFolder[] = "/var/run/";
constexpr seconds kStopLimit(30);
constexpr uint64_t kLongestStopLimit = 86400;
constexpr seconds kKillLimit(10);  // for a process to disappear after SIGKILL

std::string PidFile(const std::string& unit) {
    return TARQ::RootPath(kRunFolder + unit + ".pid");
}

/// The unit's process when it runs. False, with errno set, when that cannot be found out.
bool FindProcess(const std::string& unit, std::optional<Process>* process) {
    const auto text = base::ReadFile(PidFile(unit));
    if (!text) {
        return errno == ENOENT;
    }
    ProcessId id;
    if (std::istringstream(*text) >> id.pid >> id.start_time) {
        *process = Process::Open(id);
    }
    return true;
}

bool WritePidFile(const std::string& unit, const ProcessId& id) {
    return base::ReplaceFile(
        PidFile(unit), std::to_string(id.pid) + "\n" + std::to_string(id.start_time) + "\n", 0644);
}

/// The words of the unit's command; none, with the error code set, when it has no command that
/// could be run.
std::vector<std::string> ReadCommand(const std::string& unit) {
    tarq_internal::Section section;
    const ReadResult result =
        tarq_internal::ReadSection(TARQ::RootPath(kConfiguration), unit, &section);
    const auto command = section.find("command");
    if (result == ReadResult::kFailed) {
        return {};
    }
    if (command == section.end()) {
        Failed(result == ReadResult::kFound ? TARQ_ERR_NO_KEY : TARQ_ERR_NO_SECTION);
        return {};
    }
    std::vector<std::string> words =
        SplitCommand(command->second).value_or(std::vector<std::string>());
    if (words.empty() || words[0].empty() || words[0][0] != '/') {
        Failed(TARQ_ERR_BAD_PARAMETER);
        return {};
    }
    return words;
}

/// False, with the error code set, when what is configured is no number of seconds.
bool ReadStopLimit(const std::string& unit, seconds* limit) {
    std::string text;
    switch (tarq_internal::ReadValue(TARQ::RootPath(kConfiguration), unit, "stop_seconds", &text)) {
        case ReadResult::kFailed:
            return false;
        case ReadResult::kAbsent:
            *limit = kStopLimit;
            return true;
        case ReadResult::kFound:
            break;
    }
    const std::optional<uint64_t> number = base::ParseNumber(text, kLongestStopLimit);
    if (!number) {
        Failed(TARQ_ERR_BAD_PARAMETER);
        return false;
    }
    *limit = seconds(*number);
    return true;
}

/// The right to change a unit's state, among all processes. Waits for as long as a stop may take.
/// An empty lock, with the error code set, when it cannot be had.
base::FileLock LockUnit(const std::string& unit) {
    seconds stop;
    if (!ReadStopLimit(unit, &stop)) {
        return {};
    }
    base::FileLock lock(TARQ::RootPath(kRunFolder + unit + ".lock"), stop + 2 * kKillLimit);
    if (!lock) {
        const int reason = errno;
        syslog(LOG_ERR, "tarqsystemd: %s", lock.Problem().c_str());
        errno = reason;
        Failed(TARQ_ERR_SERVICE);
    }
    return lock;
}

}  // namespace

Status Supervisor::StatusOf(const std::string& unit) {
    std::optional<Process> process;
    if (!FindProcess(unit, &process)) {
        Failed(TARQ_ERR_SERVICE);
        return Status::kUnknown;
    }
    return process ? Status::kActive : Status::kInactive;
}

Outcome Supervisor::Start(const std::string& unit) {
    const base::FileLock lock = LockUnit(unit);
    if (!lock) {
        return Outcome::kFailed;
    }
    std::optional<Process> process;
    if (!FindProcess(unit, &process)) {
        return Failed(TARQ_ERR_SERVICE);
    }
    if (process) {
        return Outcome::kDone;
    }
    const std::vector<std::string> command = ReadCommand(unit);
    if (command.empty()) {
        return Outcome::kFailed;
    }
    // The number is on record before the command runs: whatever ends us here, no command runs that
    // nobody can stop.
    auto launch = BackgroundLaunch::Prepare(command);
    if (!launch || !WritePidFile(unit, launch->Id())) {
        return Failed(TARQ_ERR_SERVICE);
    }
    if (!launch->Release()) {
        const int reason = errno;
        unlink(PidFile(unit).c_str());
        errno = reason;
        return Failed(TARQ_ERR_SERVICE);
    }
    return Outcome::kDone;
}

Outcome Supervisor::Stop(const std::string& unit) {
    const base::FileLock lock = LockUnit(unit);
    if (!lock) {
        return Outcome::kFailed;
    }
    std::optional<Process> process;
    if (!FindProcess(unit, &process)) {
        return Failed(TARQ_ERR_SERVICE);
    }
    if (process) {
        seconds limit;
        if (!ReadStopLimit(unit, &limit)) {
            return Outcome::kFailed;
        }
        if (!process->Signal(SIGTERM)) {
            return Failed(TARQ_ERR_SERVICE);
        }
        if (!process->WaitForEnd(limit) &&
            (!process->KillGroup() || !process->WaitForEnd(kKillLimit))) {
            errno = ETIMEDOUT;
            return Failed(TARQ_ERR_SERVICE);
        }
    }
    unlink(PidFile(unit).c_str());
    return Outcome::kDone;
}

}  // namespace tarq_systemd
