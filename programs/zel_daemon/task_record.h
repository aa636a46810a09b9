// A task as the daemon keeps it: its settings, and what is the daemon's own.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "ZEL/sync_obj.h"
#include "programs/common/question.h"
#include "programs/common/run_result.h"
#include "programs/common/task_settings.h"

namespace zel_daemon {

struct TaskRecord : programs::TaskSettings {
    bool paused = false;  ///< started by nobody but a person
    /// Runs of the schedule up to this moment (seconds since the epoch) have been made or given up.
    int64_t checked_until = 0;
    /// All shares were compared whole with their copies at this moment or later (seconds since the
    /// epoch); 0: not yet.
    int64_t compared = 0;

    bool IsRealtime() const { return Info().GetSchedule().GetMode() == ZEL::SCHD_MODE_REALTIME; }
};

/// Why a run was made.
enum class RunReason : int {
    kSchedule = 0,  ///< it was due
    kChange = 1,    ///< something below its shares had changed
    kRequest = 2,   ///< a person asked for it
    kRetry = 3      ///< the run before had failed
};

/// One run of a task in the history.
struct RunRecord {
    uint64_t id = 0;
    uint64_t task_id = 0;
    RunReason reason = RunReason::kSchedule;
    int64_t start = 0;  ///< seconds since the epoch
    int64_t end = 0;    ///< 0 while it runs
    ZEL::TASK_RESULT result = ZEL::TASK_RESULT_NONE;
    int status =
        0;  ///< the server's or rsync's, see tarq/rsync_wrapper.h; 0 also for local failures
    std::string error;    ///< what failed and where, for a person; empty after a success
    std::string details;  ///< what rsync and ssh wrote about it, line by line; may be empty
    uint64_t files_sent = 0;
    uint64_t files_deleted = 0;
    uint64_t bytes_sent = 0;
    uint64_t rsync_runs = 0;  ///< copies made, without the server commands around them
};

/// What a person is asked, by share.
using Questions = std::map<std::string, programs::Question>;

/// A move that the server has not been told of yet.
struct StoredMove {
    uint64_t id = 0;
    programs::ShareMove move;
};

/// What a run leaves behind, beside its record.
struct RunEnd {
    std::vector<uint64_t> sent;        ///< numbers of the stored changes that the server has taken
    std::vector<uint64_t> unsent;      ///< and of those that it has not
    std::vector<uint64_t> moved = {};  ///< of the stored moves that it was told of
    /// By share: what a person is to be asked from now on; nothing: no more. Of all other shares
    /// it stays as it is.
    std::map<std::string, std::optional<programs::Question>> questions = {};
    std::map<std::string, uint64_t> files = {};  ///< of the shares' copies, where that has changed
};

}  // namespace zel_daemon
