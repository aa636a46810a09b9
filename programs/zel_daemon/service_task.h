// What the three sources of the service share: a task with all that goes on with it.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "programs/zel_daemon/service.h"

namespace zel_daemon {

/// A run whose end is still to be stored.
struct EndedRun {
    RunRecord record;
    std::vector<uint64_t> sent;    ///< changes that the server has taken
    std::vector<uint64_t> unsent;  ///< and those that it has not
};

/// A task and all that goes on with it.
struct Service::Task {
    Task(TaskRecord kept, const Clock& clock) : record(std::move(kept)) {
        MakePlan(clock);
        debts.SetShares(record.Info().GetShareList());
    }

    void MakePlan(const Clock& clock) {
        plan.emplace(clock, record.Info().GetSchedule(), record.checked_until);
    }

    bool HasGathered() const { return gather_first.has_value(); }
    bool Watches() const { return record.IsRealtime() && !record.paused; }

    TaskRecord record;
    std::optional<TaskPlan> plan;  // always there
    ShareDebts debts;
    std::shared_ptr<Connection> connection;
    std::unique_ptr<ActiveRun> active;
    std::optional<EndedRun> ended;  // the store does not know of its end yet
    bool by_person = false;         // the run under way was cancelled by a person
    bool requested = false;         // a person wants a run
    int64_t due_since = 0;          // on the clock that never jumps; 0: not due
    uint64_t pending = 0;           // stored changes, those being sent included
    bool held = false;              // a person cancelled: what is pending waits for a new change
    std::optional<RunRecord> last;  // the last run that ended

    // Realtime tasks.
    std::map<std::string, ChangeSet> gathered;  // by share
    std::optional<int64_t> gather_first;        // when the first of them came
    int64_t gather_last = 0;
    int64_t store_retry_at = 0;      // not before: the store could not be written
    std::optional<int64_t> poll_at;  // the next whole comparison of what cannot be watched
    std::map<std::string, std::string> notes;  // by share
    std::string store_note;
};

}  // namespace zel_daemon
