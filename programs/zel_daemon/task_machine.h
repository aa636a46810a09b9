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
#include "programs/zel_daemon/copy_ledger.h"
#include "programs/zel_daemon/daemon_config.h"
#include "programs/zel_daemon/move_ledger.h"
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
/// folded, stored, sent, and forgotten only when the server has taken them. A full resync that
/// failed makes a share kUnknown again. After a start of the daemon and after a loss of the watch,
/// what changed meanwhile is to be searched here (ToSearch()), and only where that cannot tell is
/// the share kUnknown; what cannot be watched is searched every so often, after another try to
/// watch it.
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
    /// Reads the stored moves of a share.
    using ReadMoves = std::function<std::vector<StoredMove>(const std::string& share)>;

    /// `clock` and `config`, which may change, outlive it. For `random` see TaskPlan.
    TaskMachine(TaskRecord record, const Clock& clock, const DaemonConfig& config,
                std::function<double()> random = nullptr);

    // ---- The question ----

    /// What is to be done now; when several things are, a run comes last.
    Step NextStep();

    // ---- What happens ----

    /// After the daemon's start: whether stored changes wait, and the last run, which is made up
    /// for when it failed or was cut off; `questions` wait for a person; `files`
    /// are known of the copies.
    void Restored(bool has_changes, std::optional<RunRecord> last, Questions questions = {},
                  const CopyLedger::Files& files = {});
    /// The task has other settings, which are stored. REQUIRES that no run is under way. Its stored
    /// changes are void: everything is resynced.
    void Edited(TaskRecord record);
    /// The task has been paused or resumed, which is stored.
    void PauseSet(TaskRecord record);
    /// The process's time zone is another one now.
    void ZoneChanged() { plan_->ZoneChanged(); }

    /// Something changed at `path` below the folder of a share.
    void Changed(const std::string& share, const std::string& path);
    /// What was at `from` is at `to` now, both of them as Watcher::OnMove has them.
    void Moved(const std::string& share, const std::string& from, const std::string& to);
    /// Nothing is left to hear of what has been changed and moved until now.
    void HeardAll();
    /// Changes of a share may have been missed; `lasting`: and will be, as some of it is not
    /// watched.
    void Lost(const std::string& share, bool lasting);
    /// The copy of a share has much otherwise, whatever is known of it: it is resynced.
    void Differs(const std::string& share) { debts_.OweResync(share); }
    /// A share's folder is watched from now on: all that changed before may have been missed.
    void Watched(const std::string& share);
    /// What changed unnoticed in a share was searched: the search with this number of ToSearch(),
    /// else it counts for nothing. `compared`: all of it was told to Changed(), and all of the
    /// share was last compared with its copy then; nothing: that cannot be known here.
    void Searched(const std::string& share, uint64_t number, std::optional<int64_t> compared);
    /// All of a share is watched again, and nothing was missed since the last rescan.
    void Covered(const std::string& share) { unwatched_.erase(share); }
    /// What was away may be there again; `is_there` is asked about the shares that wait for theirs.
    void Recovered(const std::set<Recovery>& what,
                   const std::function<bool(const std::string& share)>& is_there);

    /// A person wants a run. Nothing, when one is under way.
    void Asked();
    /// A person allows what was asked, for one push of each share: all are pushed, and as much is
    /// let go as was told. It holds until a share's push has succeeded. False when nothing is
    /// asked.
    bool Confirmed();
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
    /// What was moved meanwhile in that share, in order.
    const std::vector<programs::ShareMove>& DebouncedMoves(const std::string& share);
    void ChangesStored();

    void Rescanned();

    /// What a run sends that begins now, without its number; nothing when that is nothing.
    /// REQUIRES that debounced changes were stored. What `read` throws comes out; StoreFailed() is
    /// due then.
    std::optional<RunPlan> Begin(const Step& step, const ReadChanges& read,
                                 const ReadMoves& read_moves);
    /// The run that Begin() gave, with its number, is under way.
    void Started(RunPlan plan);
    /// It has ended: its record, which is Last() from now on.
    const RunRecord& Ended(const programs::RunResult& result, const programs::RunTotals& totals);

    // ---- What is so ----

    const TaskRecord& Record() const { return record_; }
    /// Whether its shares' folders are to be watched.
    bool Watches() const { return record_.IsRealtime() && !record_.paused; }
    const std::set<std::string>& Unwatched() const { return unwatched_; }
    /// The shares in which something may have changed that nobody has told, each with a number that
    /// is another once more may have.
    const std::map<std::string, uint64_t>& ToSearch() const { return to_search_; }
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
    /// Whether nothing is due, under way or owed, nobody is asked, and the last run has brought the
    /// shares' copies into step.
    bool IsAtRest() const;
    /// The same of one share: others of the task may wait for their next try.
    bool IsAtRest(const std::string& share) const { return IsAtRest() && !debts_.Owes(share); }
    /// Why nothing can be stored; empty when it can.
    const std::string& StoreProblem() const { return store_problem_; }
    /// What waits until a person allows it.
    const Questions& Asking() const { return questions_; }
    /// What the next try of something that failed waits for, for people; empty when none waits.
    std::string WaitsFor() const;

private:
    void MakePlan();
    void OweSearch(const std::string& share);
    void NoteChange(const std::string& share, const std::string& path);
    bool IsInStep(const std::string& share, const std::string& path);
    std::optional<int64_t> NextRunAt(Step& step);
    void TakeSchedule();
    void PutBack();
    void Settle(const RunPlan& plan, const programs::RunResult& result);
    void NoteCompared(const RunPlan& plan, const programs::RunResult& result);
    void PlanComparison();
    void OweComparisons();
    void SettleQuestions(const RunPlan& plan, const programs::RunResult& result);
    int64_t NextPoll() const { return clock_.Elapsed() + config_.poll.count() * 1000; }
    RetryDelays Delays() const { return {config_.retry_first.count(), config_.retry_max.count()}; }

    const Clock& clock_;
    const DaemonConfig& config_;
    const std::function<double()> random_;
    TaskRecord record_;
    bool record_changed_ = false;   // and the store does not know
    std::optional<TaskPlan> plan_;  // always there
    ShareDebts debts_;
    /// When a share was last compared whole, on the clock that never jumps and on the wall's.
    struct Comparison {
        int64_t elapsed = 0;
        int64_t moment = 0;
    };
    std::map<std::string, Comparison> compared_;  // since the start; without those that are due
    std::optional<int64_t> compare_at_;           // when the first of these is due
    CopyLedger copies_;

    // Runs.
    bool requested_ = false;
    int64_t due_since_ = 0;
    std::optional<RunPlan> running_;
    bool by_person_ = false;  // the run under way was cancelled by a person
    bool held_ = false;       // a person cancelled: a realtime task waits for a new change
    std::optional<RunRecord> last_;
    std::optional<RunEnd> ended_;
    Questions questions_;
    std::map<std::string, programs::Consent> consents_;  // by share
    int64_t store_retry_at_ = 0;
    std::string store_problem_;

    // The watch.
    std::map<std::string, ChangeSet> debounced_;  // by share
    MoveLedger moves_;
    std::optional<int64_t> first_change_;  // of these; nothing: there are none
    int64_t last_change_ = 0;
    std::set<std::string> unwatched_;  // shares of which something is not watched
    std::map<std::string, uint64_t> to_search_;
    uint64_t last_search_ = 0;
    int64_t poll_at_ = 0;  // when these are scanned again
};

}  // namespace zel_daemon
