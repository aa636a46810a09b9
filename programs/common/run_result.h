// What a run is to do, and what of it was done: one failure a share or path, and their sum.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "programs/common/failure.h"

namespace programs {

/// What a status that is not 0 comes to, see tarq/rsync_wrapper.h.
FailureKind KindOf(int status);

/// What a failure stands in the way of.
enum class Reach {
    kRun,  ///< everything: the server is not reached, refuses this client, or a person has ended it
    kShare,  ///< one share
    kPaths   ///< one path of a share: what is beside it is taken
};

/// A failure of a run. Its status is the server's or rsync's (tarq/rsync_wrapper.h); 0 for local
/// troubles.
struct RunFailure : Failure {
    RunFailure(FailureKind kind, int status, const std::string& text, Reach how_far = Reach::kRun,
               std::string written = {})
        : Failure(kind, text, status), reach(how_far), details(std::move(written)) {}

    Reach reach;
    std::string details;  ///< what rsync and ssh wrote about it, line by line; may be empty
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
    std::vector<Undone> undone;  ///< in the order of the run
    /// That which ended the run, else the first; none after a success. Its text names each failure,
    /// with its reason; after many it tells their number.
    std::optional<RunFailure> failure;
};

/// What a run sent, all shares together.
struct RunTotals {
    uint64_t files_sent = 0;
    uint64_t files_deleted = 0;
    uint64_t bytes_sent = 0;  ///< on the wire
    uint64_t rsync_runs = 0;  ///< copies made, without the commands around them
};

using ShareOrders = std::vector<const ShareOrder*>;

/// What a run that has ended did not come to. `is_first`: the failure is told with the first of
/// them, which counts as tried.
void LeaveUndone(const ShareOrders& shares, const RunFailure& failure, bool is_first,
                 std::vector<Undone>& undone);

/// The failure of a run that left these undone.
std::optional<RunFailure> Sum(const std::vector<Undone>& undone);

/// That of a run that has failed as a whole, before anything of `order` was taken.
RunResult NothingDone(const RunOrder& order, const RunFailure& failure);

}  // namespace programs
