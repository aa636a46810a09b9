// A task as a state machine: events go in, and the next step to be done for the task comes out.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "programs/zel_daemon/change_set.h"
#include "programs/zel_daemon/daemon_config.h"
#include "programs/zel_daemon/recovery_watch.h"
#include "programs/zel_daemon/run_plan.h"
#include "programs/zel_daemon/share_debts.h"
#include "programs/zel_daemon/task_plan.h"

namespace zel_daemon {

/// What is to be done for a task now: by the caller, who reports back when it is done.
struct Step {
    enum class Kind {
        kWait,          ///< nothing
        kStoreEnd,      ///< store how the last run ended: End() and Last(), then EndStored()
        kStoreRecord,   ///< store Record(), then RecordStored()
        kStoreChanges,  ///< store DebouncedChanges(), then ChangesStored()
        kRescan,        ///< try to watch the shares Unwatched() in full, after Rescanned()
        kRun            ///< make a run, once there is room for it: Begin(), then Started()
    };
    Kind kind = Kind::kWait;
    RunReason reason = RunReason::kSchedule;  ///< of a run
    bool all = false;                         ///< of a run: all shares, in full
    /// Milliseconds until time brings another step than a run that is due; nothing: it does not.
    std::optional<int64_t> wait;
};

/// One task, with all rules of when it does what. It does nothing itself: it has neither threads
/// nor files, and reads the time from the clock that it was given.
///
/// A realtime task lives so: its shares' folders are scanned and watched, and each share begins as
/// kUnknown (see ShareState). A full resync makes it kTracked; from then on changes are debounced,
/// folded, stored, sent, and forgotten only when the server has taken them. A loss of the watch
/// makes a share kUnknown again, and so does a full resync that failed; what cannot be watched is
/// resynced every so often, after another try to watch it.
///
/// Any task's run may come by its schedule or be asked for by a person: then all shares are
/// resynced. What of it fails is tried again, see ShareDebts and TaskPlan.
///
/// Threads: one thread.
class TaskMachine {
public:
    /// Reads the stored changes of a share whose number is larger than `after`.
    using ReadChanges =
        std::function<std::vector<ZEL::Event>(const std::string& share, uint64_t after)>;

    /// `clock` and `config`, which may change, outlive it. For `random` see TaskPlan.
    TaskMachine(TaskRecord record, const Clock& clock, const DaemonConfig& config,
                std::function<double()> random = nullptr);

    // ---- The question ----

    /// What is to be done now; when several things are, a run comes last.
    Step NextStep();

    // ---- What happens ----

    /// After the daemon's start: whether stored changes wait, and the last run, which is made up
    /// for when it failed or was cut off.
    void Restored(bool has_changes, std::optional<RunRecord> last);
    /// The task has other settings, which are stored. REQUIRES that no run is under way. Its stored
    /// changes are void: everything is resynced.
    void Edited(TaskRecord record);
    /// The task has been paused or resumed, which is stored.
    void PauseSet(TaskRecord record);
    /// The process's time zone is another one now.
    void ZoneChanged() { plan_->ZoneChanged(); }

    /// Something changed at `path` below the folder of a share.
    void Changed(const std::string& share, const std::string& path);
    /// Changes of a share may have been missed; `lasting`: and will be, as some of it is not
    /// watched.
    void Lost(const std::string& share, bool lasting);
    /// A share's folder is watched from now on: all that changed before may have been missed.
    void Watched(const std::string& share);
    /// All of a share is watched again, and nothing was missed since the last rescan.
    void Covered(const std::string& share) { unwatched_.erase(share); }
    /// What was away may be there again; `is_there` is asked about the shares that wait for theirs.
    void Recovered(const std::set<Recovery>& what,
                   const std::function<bool(const std::string& share)>& is_there);

    /// A person wants a run. Nothing, when one is under way.
    void Asked();
    /// A person wants the run under way, or the one that waits, to end for good. A realtime task's
    /// changes wait for the next change then. False when there is none.
    bool Cancelled();

    // ---- Steps ----

    /// Something could not be stored: it is tried again in a while. A run that was to begin does
    /// not. `problem` is for people.
    void StoreFailed(const std::string& problem);

    /// What a run ended with that the store does not know of yet; nothing: no such run.
    const std::optional<RunEnd>& End() const { return ended_; }
    void EndStored();
    void RecordStored();

    bool HasDebounced() const { return first_change_.has_value(); }
    /// By share, folded. REQUIRES that ChangesStored() comes before the next Changed().
    std::map<std::string, std::vector<std::string>> DebouncedChanges();
    void ChangesStored();

    void Rescanned();

    /// What a run sends that begins now, without its number; nothing when that is nothing.
    /// REQUIRES that debounced changes were stored. What `read` throws comes out; StoreFailed() is
    /// due then.
    std::optional<RunPlan> Begin(const Step& step, const ReadChanges& read);
    /// The run that Begin() gave, with its number, is under way.
    void Started(RunPlan plan);
    /// It has ended: its record, which is Last() from now on.
    const RunRecord& Ended(const programs::RunResult& result, const programs::RunTotals& totals);

    // ---- What is so ----

    const TaskRecord& Record() const { return record_; }
    /// Whether its shares' folders are to be watched.
    bool Watches() const { return record_.IsRealtime() && !record_.paused; }
    const std::set<std::string>& Unwatched() const { return unwatched_; }
    ShareState StateOf(const std::string& share) const { return debts_.StateOf(share); }
    /// Whether `test` holds for one of the shares of a run that is due.
    bool AnyShare(const Step& step,
                  const std::function<bool(const std::string& share)>& test) const;
    /// Since when a run has been due, on the clock that never jumps; 0: none is.
    int64_t DueSince() const { return due_since_; }
    const std::optional<RunPlan>& Running() const { return running_; }
    /// The last run that ended.
    const std::optional<RunRecord>& Last() const { return last_; }
    /// In seconds since the epoch; nothing when the schedule has none, or the task is paused.
    std::optional<int64_t> NextRun() const;
    /// Milliseconds until something that failed is tried again.
    std::optional<int64_t> UntilRetry() const;
    /// Why nothing can be stored; empty when it can.
    const std::string& StoreProblem() const { return store_problem_; }
    /// What the next try of something that failed waits for, for people; empty when none waits.
    std::string WaitsFor() const;

private:
    void MakePlan();
    std::optional<int64_t> NextRunAt(Step& step);
    void TakeSchedule();
    void PutBack();
    void Settle(const RunPlan& plan, const programs::RunResult& result);
    int64_t NextPoll() const { return clock_.Elapsed() + config_.poll.count() * 1000; }
    RetryDelays Delays() const { return {config_.retry_first.count(), config_.retry_max.count()}; }

    const Clock& clock_;
    const DaemonConfig& config_;
    const std::function<double()> random_;
    TaskRecord record_;
    bool record_changed_ = false;   // and the store does not know
    std::optional<TaskPlan> plan_;  // always there
    ShareDebts debts_;

    // Runs.
    bool requested_ = false;
    int64_t due_since_ = 0;
    std::optional<RunPlan> running_;
    bool by_person_ = false;  // the run under way was cancelled by a person
    bool held_ = false;       // a person cancelled: a realtime task waits for a new change
    std::optional<RunRecord> last_;
    std::optional<RunEnd> ended_;
    int64_t store_retry_at_ = 0;
    std::string store_problem_;

    // The watch.
    std::map<std::string, ChangeSet> debounced_;  // by share
    std::optional<int64_t> first_change_;         // of these; nothing: there are none
    int64_t last_change_ = 0;
    std::set<std::string> unwatched_;  // shares of which something is not watched
    int64_t poll_at_ = 0;              // when these are scanned again
};

}  // namespace zel_daemon
