// What the daemon must not forget: tasks, changes that wait to be sent, and the history of runs.
//
// One SQLite file in WAL mode, mode 0600 (it holds passwords). Every operation is one transaction:
// a killed process leaves the state before it or after it.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "programs/zel_daemon/deposit_note.h"
#include "programs/zel_daemon/task_record.h"
#include "programs/zel_daemon/verification.h"

namespace zel_daemon {

/// Every operation may throw Failure, whose text says which file, what failed and
/// what to do; nothing has changed then. Its kind is kLocal where only a person can mend it: the
/// file is damaged, lost, or not this program's.
///
/// Threads: one thread.
class Store {
public:
    /// Runs kept of each task; the oldest are dropped when new ones begin.
    static constexpr int kRunsKept = 200;
    /// Moves kept of each share; what else was moved is sent.
    static constexpr int kMovesKept = 1024;

    /// Opens the file, making it (and its folder, 0700) when there never was one. One that is empty
    /// or gone since is refused: a fresh start is for a person to want, see Renew(). One with an
    /// older layout is brought up to date; one with a newer layout, and a database that is no
    /// store, are refused and left as they are. Runs that had not ended when the file was last used
    /// are marked as failed ("the daemon was stopped"), with their start as their end, and their
    /// events wait again.
    explicit Store(const std::string& path);
    /// Puts what is there aside and makes a new, empty store. The name that the old one has now,
    /// empty when there was none. REQUIRES that no daemon uses it.
    static std::string Renew(const std::string& path);
    ~Store();
    const std::string& Path() const;
    Store(const Store&) = delete;
    Store& operator=(const Store&) = delete;

    /// All tasks, by id.
    std::vector<TaskRecord> Tasks();
    /// Stores a new task and returns its id, never used before. The record's own id is not looked
    /// at. A name that is taken throws.
    uint64_t AddTask(const TaskRecord& record);
    /// Replaces the task with the record's id. Throws when there is none, or the name is taken.
    void UpdateTask(const TaskRecord& record);
    /// The same, and forgets all changes of the task, whatever their state, what a person was
    /// asked, and what was known and verified of the copies of shares that are not the task's any
    /// more; `other_copies`: of all.
    void ResetTask(const TaskRecord& record, bool other_copies = false);
    /// Removes a task with its events and its history.
    void RemoveTask(uint64_t id);

    /// Of the changes of a share no more wait than so many; the paths of more are folded to those
    /// of folders, and have new ids.
    static constexpr uint64_t kMaxWaiting = 131072;
    /// Stores changes as waiting, and what was moved, in one transaction; a change that waits
    /// already is not stored twice. Of a share's moves the last kMovesKept are kept.
    void AddEvents(uint64_t task_id, const std::string& share,
                   const std::vector<std::string>& paths,
                   const std::vector<programs::ShareMove>& moves = {});
    /// What was moved in a share and the server was not told of, oldest first.
    std::vector<StoredMove> Moves(uint64_t task_id, const std::string& share);
    /// The changes of a task that wait, oldest first.
    std::vector<ZEL::Event> PendingEvents(uint64_t task_id);
    /// Those of one share whose id is larger than `after`.
    std::vector<ZEL::Event> PendingEvents(uint64_t task_id, const std::string& share,
                                          uint64_t after);
    /// The changes of a task that the server has not taken yet: that wait or are being sent.
    uint64_t CountEvents(uint64_t task_id);

    /// Notes the beginning of a run, which sends these changes, and returns its id. A change of the
    /// same path that comes now waits on its own.
    uint64_t BeginRun(uint64_t task_id, RunReason reason, int64_t start,
                      const std::vector<uint64_t>& sending = {});
    /// How many files the shares' copies have, by task id and share, as far as that is known.
    std::map<uint64_t, std::map<std::string, uint64_t>> FilesOfCopies();
    /// What waits for a person, by task id.
    std::map<uint64_t, Questions> AllQuestions();

    /// How far the copies are verified, and what is damaged, by task id.
    std::map<uint64_t, Verification::Shares> AllVerifications();
    /// Notes the end of a slice of the share.
    void EndSlice(uint64_t task_id, const std::string& share, const VerifiedSlice& slice);

    /// Notes how the run with the record's id ended (nothing of it when its task is gone), what a
    /// person is asked from now on, and how many files the copies have. The
    /// changes that were sent are removed, as are the moves that were told; the unsent ones wait
    /// again, each as one with a change of the same path that came since.
    void EndRun(const RunRecord& run, const RunEnd& end = {});
    /// The last runs of a task, newest first.
    std::vector<RunRecord> Runs(uint64_t task_id, unsigned int limit);
    /// The last run of each task that has one, the running ones included, by task id.
    std::vector<RunRecord> LastRuns();

    /// What each account of a server has taken as this machine's configuration.
    std::vector<DepositNote> Deposits();
    /// Notes it in place of what was noted of the account before.
    void NoteDeposit(const DepositNote& deposit);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace zel_daemon
