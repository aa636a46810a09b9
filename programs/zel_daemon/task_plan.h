// When a task is to run next: its schedule, what was missed, and what failed.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>

#include "ZEL/sync_obj.h"
#include "programs/zel_daemon/backoff.h"

namespace zel_daemon {

/// The times that plans are made with. Tests set their own.
class Clock {
public:
    virtual ~Clock() = default;
    /// Seconds since the epoch, as people's clocks show it: may jump.
    virtual int64_t Now() const = 0;
    /// Milliseconds since some moment, time asleep included: never jumps.
    virtual int64_t Elapsed() const = 0;
};

class SystemClock : public Clock {
public:
    int64_t Now() const override;
    int64_t Elapsed() const override;
};

/// The plan of one task. It knows nothing of pauses and of running: whoever holds it asks only when
/// the task may run.
///
/// Schedule: a run that was missed (the machine was off, the clock jumped ahead) is made up for
/// once, however many were missed. After a jump back the schedule goes on from the time that the
/// clock shows. A run that failed as a whole is tried again after a while, see Backoff.
///
/// Threads: one thread.
class TaskPlan {
public:
    /// `checked_until`: runs of the schedule up to here have been made. `random` gives numbers from
    /// 0 to below 1; tests set their own.
    TaskPlan(const Clock& clock, const ZEL::Schedule& schedule, int64_t checked_until,
             std::function<double()> random = nullptr);

    /// The schedule's next run, in seconds since the epoch; one in the past is due now. Nothing for
    /// manual and realtime tasks and when no run will come.
    std::optional<int64_t> NextRun() const;
    /// The process's time zone is another one now.
    void ZoneChanged() { next_after_.reset(); }
    /// True when the schedule wants a run now. A clock that was set back by more than a minute is
    /// noticed here, and changes CheckedUntil().
    bool ScheduleDue();
    /// A run of the schedule starts, or is given up: the next one counts from now.
    void ScheduleTaken();
    /// What must be stored: runs up to here are done with.
    int64_t CheckedUntil() const { return checked_until_; }

    /// A run failed as a whole: sets the moment of the next try.
    void Failed(const RetryDelays& delays);
    /// What it failed for may be over, see Backoff.
    void Hasten(int64_t gap) { retry_.Hasten(clock_.Elapsed(), gap); }
    /// The server was reached, or a person has cancelled: no try is waiting any more.
    void Settled() { retry_.Settled(); }
    /// When a failed run is tried again, on the clock that never jumps; nothing when none waits.
    std::optional<int64_t> RetryAt() const { return retry_.At(); }
    /// A number from 0 to below 1.
    double Chance() { return random_(); }

private:
    bool WasSetBack(int64_t now) const;
    std::optional<int64_t> Reckon() const;

    const Clock& clock_;
    ZEL::Schedule schedule_;
    int64_t checked_until_;
    // Asking for the zone's rules costs more than all else, so that the answer is kept.
    mutable std::optional<int64_t> next_;
    mutable std::optional<int64_t> next_after_;  // the checked_until_ that next_ belongs to
    std::function<double()> random_;
    Backoff retry_;
};

}  // namespace zel_daemon
