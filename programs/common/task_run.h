// Runs of shares against their server, from the first probe to the last word: what the daemon's
// workers and `zelctl push` do alike.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "ZEL/sync_obj.h"
#include "programs/common/failure.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// What a status that is not 0 comes to, see tarq/rsync_wrapper.h.
FailureKind KindOf(int status);

/// What a failure stands in the way of.
enum class Reach {
    kRun,  ///< everything: the server is not reached, refuses this client, or a person has ended it
    kShare,  ///< one share
    kPaths   ///< one path of a share: what is beside it is taken
};

/// How an operation of a run ended, for a program and for a person.
struct RunFailure {
    FailureKind kind = FailureKind::kNone;
    int status = 0;     ///< the server's or rsync's (tarq/rsync_wrapper.h); 0 for local troubles
    std::string error;  ///< what failed, where and what to do; empty when nothing did
    Reach reach = Reach::kRun;
    std::string details = {};  ///< what rsync and ssh wrote about it, line by line; may be empty

    bool Ok() const { return kind == FailureKind::kNone; }
};

/// What a run sent, all shares together.
struct RunTotals {
    uint64_t files_sent = 0;
    uint64_t files_deleted = 0;
    uint64_t bytes_sent = 0;  ///< on the wire
    uint64_t rsync_runs = 0;  ///< copies made, without the commands around them
};

/// One share of a run, and which of its paths: "/" is all of it, others begin with "/". A path that
/// is not there any more stands for the nearest folder above it that is.
struct ShareOrder {
    std::string share;
    std::vector<std::string> paths = {"/"};
    /// Something of the share is known to be behind and is not in this run, so that the server is
    /// not told that its copy is complete.
    bool rest_waits = false;
};

/// What a run is to do.
struct RunOrder {
    std::string task;  ///< the name by which the server knows that it is alive
    uint64_t task_id = 0;
    std::vector<ShareOrder> shares;
    std::vector<std::string> excludes;  ///< rsync patterns of files that stay behind
    /// Tell the server at once that the task is alive. A short run for a few changes spares the two
    /// commands; it does so only when it lasts.
    bool announce = true;
};

/// What a run left undone of one share, and why.
struct Undone {
    std::string share;
    std::vector<std::string> paths;  ///< of its order
    RunFailure failure;
    bool tried = true;  ///< false: the run had ended before it came to them
};

/// How a run ended: what is not in `undone` was taken by the server.
struct RunResult {
    /// Of the failure that ended the run, else of the first. Its text names each failure, with its
    /// reason; after many it tells their number.
    RunFailure failure;
    std::vector<Undone> undone;  ///< in the order of the run
};

/// That of a run that has failed as a whole, before anything of `order` was taken.
RunResult NothingDone(const RunOrder& order, const RunFailure& failure);

/// Told on the running thread; each may be empty.
struct RunListener {
    std::function<void(const std::string& share, const TARQ::Backup::RunProgress&)> on_progress;
    std::function<void(const std::string& share, const TARQ::Backup::RunReport&, double seconds)>
        on_share_done;
    std::function<void(const std::string& address)> on_paired;
};

/// One line of what a run would do.
using ChangeHandler = std::function<void(const std::string& share, const TARQ::Backup::RunChange&)>;

/// A connection to one server with one task's settings.
///
/// Threads: belongs to one thread; `cancel` may be set by any, and by a signal handler.
class TaskRun {
public:
    /// `cancel` outlives this object; when it is true the operation under way ends within a second,
    /// with kCancelled; within two when the server does not answer.
    TaskRun(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel, RunListener listener = {});
    ~TaskRun();
    TaskRun(const TaskRun&) = delete;
    TaskRun& operator=(const TaskRun&) = delete;

    /// Finds an address of the server that answers. Changes nothing there.
    RunFailure Connect();
    /// Asks whether the server takes these shares from this client. Changes nothing there.
    RunFailure CheckPairing(const std::vector<std::string>& shares);
    /// Pushes share after share, after Connect() unless that was done, pairing when the server does
    /// not know this client. Shares and paths that fail do not keep the others from being pushed,
    /// unless the failure is one of the whole run. A share that changes while it is copied is
    /// copied once more, a few times at most.
    RunResult Push(const RunOrder& order, RunTotals& totals);
    /// Tells what Push() would send and delete. A share of which the server holds no copy is told
    /// to `on_missing`. Changes nothing.
    RunFailure List(const RunOrder& order, const ChangeHandler& on_change,
                    const std::function<void(const std::string& share)>& on_missing);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

/// Why a share cannot be pushed: it is not in the catalogue, its folder cannot be read, or its
/// volume is not there or not fit for it. Empty when it can.
std::string ShareProblem(const std::string& share);

/// Makes the folders that the library expects of its host and no package may have made: for the
/// configuration, and for scratch files, which must be nobody else's to change: what somebody else
/// has put in their place is moved aside by who may. What is wrong; empty when all is well.
std::string PrepareHost();

}  // namespace programs
