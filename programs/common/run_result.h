// What a run is to do, and how it went: a failure for each share or path, and one for the whole
// run.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "programs/common/bandwidth.h"
#include "programs/common/brake.h"
#include "programs/common/failure.h"

namespace programs {

/// The kind of failure for a nonzero status, see tarq/rsync_wrapper.h.
FailureKind KindOf(int status);

/// How much of a run a failure affects.
enum class Reach {
    kRun,    ///< all: the server is unreachable or refuses this client, or the user ended it
    kShare,  ///< one share
    kPaths   ///< one path of a share; others can still be sent
};

/// A failure of a run. Its status is the server's or rsync's (tarq/rsync_wrapper.h); 0 for problems
/// on this machine.
struct RunFailure : Failure {
    RunFailure(FailureKind kind, int status, const std::string& text, Reach how_far = Reach::kRun,
               std::string written = {})
        : Failure(kind, text, status), reach(how_far), details(std::move(written)) {}

    /// A share that waits for a person.
    explicit RunFailure(const Question& asked);

    Reach reach;
    std::string details;  ///< what rsync and ssh printed about it, in lines; may be empty
    std::optional<Question> question;  ///< what a person is asked, of a failure of kConfirm
};

/// What cannot be noted of a share on this machine keeps the share from being pushed.
template <typename Step>
void Noted(Step step) {
    try {
        step();
    } catch (const Failure& failure) {
        throw RunFailure(failure.Kind(), 0, failure.what(), Reach::kShare);
    }
}

/// The path that is all of a share.
inline constexpr char kWholeShare[] = "/";

/// A file or folder that was moved within a share; its paths begin with "/".
struct ShareMove {
    std::string from;
    std::string to;
    /// Of a folder in which little has changed since the last push: the files below `to` that are
    /// sent in its place, once the server has made the move; at least one, which brings the folders
    /// above it along. Empty: all of it is sent.
    std::vector<std::string> instead = {};
    /// Nothing was on its way to the server while it was moved: what that has of it, and what the
    /// client believes that it has, are the same.
    bool is_settled = false;
    /// It is settled, and nothing has changed in it since the last push but its place.
    bool is_untouched = false;
};

/// A file in the place of another one of the same size and time, as which rsync would take it.
struct DoubtfulFile {
    std::string path;
    std::string ordered;  ///< that of the order's paths which it is, or is below
};

/// One share of a run, and which of its paths: "/" is all of it, others begin with "/". A path that
/// no longer exists stands for its nearest existing parent.
struct ShareOrder {
    std::string share;
    std::vector<std::string> paths = {kWholeShare};
    /// Other changes of the share are still pending and not part of this run, so the server is not
    /// told that its copy is complete.
    bool rest_waits = false;
    Brake brake = {};
    std::optional<Consent> consent = {};  ///< what a person has allowed for this push
    /// What was moved since the last push, in its order. Both ends are among `paths`, or below
    /// them: the server is told, so that less has to be sent.
    std::vector<ShareMove> moves = {};
    /// These are compared by their bytes, besides.
    std::vector<DoubtfulFile> doubtful = {};
    /// Of a comparison: these files alone, relative to the share; empty: `paths`.
    std::vector<std::string> files = {};
};

/// What a run is to do.
struct RunOrder {
    std::string task;  ///< the name under which it is reported to the server as alive
    uint64_t task_id = 0;
    std::vector<ShareOrder> shares;
    std::vector<std::string> excludes;  ///< rsync patterns of files that are not sent
    /// What a push may use; nothing: as the connection's settings say.
    std::optional<Bandwidth> bandwidth = {};
    /// Report to the server right at the start that the task is alive. A short run for a few
    /// changes saves these two commands: it reports only when it takes longer.
    bool announce = true;
    /// A copy that is new or older than known is compared whole, whatever paths were asked for.
    bool may_widen = true;
    /// Of a comparison: every file is read at both ends.
    bool by_content = false;
    /// Of a comparison: it gives way to all else on both machines, and is not made at a server that
    /// offers no reading beside pushes.
    bool background = false;
};

/// What a run did not complete of one share, and why.
struct Undone {
    std::string share;
    std::vector<std::string> paths;  ///< those of its order that failed
    RunFailure failure;
    bool tried = true;  ///< false: the run ended before they were started
};

/// The result of a run: everything that is not in `undone` was accepted by the server.
struct RunResult {
    std::vector<Undone> undone;  ///< in the order of the run
    /// The failure that ended the run, otherwise the first one; none after a success. Its text
    /// lists each failure with its reason, or only their number if there are many.
    std::optional<RunFailure> failure;
    /// What was changed in the copies, by share.
    std::map<std::string, CopyChanges> copies = {};
    /// The shares of whose moves the server was told, as far as it was to be.
    std::set<std::string> moved = {};
    /// The marks of the pushes that were begun, by share: see CopyPush.
    std::map<std::string, std::string> pushes = {};
};

/// Totals of a run over all shares.
struct RunTotals {
    uint64_t files_sent = 0;
    uint64_t files_deleted = 0;
    uint64_t bytes_sent = 0;  ///< over the network
    uint64_t rsync_runs = 0;  ///< copies, without the commands around them
};

using ShareOrders = std::vector<const ShareOrder*>;

/// Adds the shares that a run did not get to, because `failure` ended it. `is_first`: the first of
/// them was tried, and its entry reports the failure.
void LeaveUndone(const ShareOrders& shares, const RunFailure& failure, bool is_first,
                 std::vector<Undone>& undone);

/// The failure of the whole run, from what it left undone.
std::optional<RunFailure> Sum(const std::vector<Undone>& undone);

/// The result of a run that failed before any part of `order` was done.
RunResult NothingDone(const RunOrder& order, const RunFailure& failure);

}  // namespace programs
