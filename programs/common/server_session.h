// One connection's worth of talk with a server, as one task's settings have it: what pushes and
// restores have in common.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <list>
#include <string>
#include <vector>

#include "ZEL/rsyncer.h"
#include "programs/common/run_result.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// How large the answer to a command may be, and how long the server may take for it.
struct AnswerLimits {
    size_t bytes = 4096;
    unsigned int seconds = 0;  ///< 0: as configured
};
/// For commands that look at all files of a share. Servers end a connection in which nothing has
/// moved for ten minutes.
constexpr unsigned int kLongAnswer = 590;

/// rsync's exit code when files went, or were replaced, before it could read them.
constexpr int kVanishedFiles = 24;

/// Failures are thrown as RunFailure.
///
/// Threads: for use by one thread; `cancel` may be set by any thread, and by a signal handler.
struct ServerSession {
    /// `cancel_flag` must outlive this object.
    ServerSession(const ZEL::SyncInfo& sync_info, const std::atomic<bool>& cancel_flag);
    ServerSession(const ServerSession&) = delete;
    ServerSession& operator=(const ServerSession&) = delete;

    /// The Rsyncer for one operation, which runs with these options and writes to `report`.
    ZEL::Rsyncer& With(TARQ::Backup::RunOptions wanted = {});
    /// The final report to the server, which is sent even after a cancellation, but with a short
    /// time limit.
    int LastWord(const std::string& type, const std::string& name, int& status);

    /// Finds an address at which the server answers. Changes nothing there. A failed request for
    /// the version is an error, not a sign of an old server: the following commands would be sent
    /// in the wrong form.
    void Find();

    /// Sends the lines of a command and returns its status; the bytes for its outfile come to
    /// `answer`.
    int Send(std::list<std::string> lines, std::string& answer, const AnswerLimits& limits = {});
    /// Sends a command about a share that the library does not know, with these lines besides, and
    /// returns its status; the bytes for its outfile come to `answer`.
    int Ask(const std::string& command, const std::string& share,
            const std::list<std::string>& lines, std::string& answer,
            const AnswerLimits& limits = {});
    /// The module that an answer names; empty when it names none.
    static std::string ModuleIn(const std::string& answer);

    /// The failure of the last operation, which ended with `status`.
    RunFailure Failed(const std::string& what, int status, Reach reach = Reach::kRun) const;
    bool Silent() const { return report.status == TARQ::Backup::STATUS_TIMEOUT; }

    ZEL::SyncInfo info;
    const std::atomic<bool>& cancel;
    TARQ::Backup::RunOptions options;  // for the current operation
    TARQ::Backup::RunReport report;    // of the last operation
    std::chrono::steady_clock::time_point
        patient_until;                // time limit that overrides a cancellation
    std::function<bool()> interrupt;  // a further reason to end the current operation
    const char* goes_on = "the next run completes the copy";  // after an end by the user
    bool connected = false;  // the server was reached at one of its addresses
    ZEL::Rsyncer rsyncer;
};

/// As the library takes it.
std::list<std::string> ToList(const std::vector<std::string>& items);

/// Adds up what the parts of a run report: what was looked at, ...
void AddFiles(TARQ::Backup::RunReport& sum, const TARQ::Backup::RunReport& part);
/// ... what was changed ...
void AddChanges(TARQ::Backup::RunReport& sum, const TARQ::Backup::RunReport& part);
/// ... and what travelled.
void AddTraffic(TARQ::Backup::RunReport& sum, const TARQ::Backup::RunReport& part);

/// "share 'photos'", printable.
std::string QuotedShare(const std::string& share);

}  // namespace programs
