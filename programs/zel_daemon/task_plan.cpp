#include "programs/zel_daemon/task_plan.h"

#include <time.h>

#include <algorithm>
#include <limits>
#include <random>

namespace zel_daemon {

namespace {

// A clock that is set right by a little shows moments again whose runs have been made: they are not
// made twice, and none after them is lost.
constexpr int64_t kSetRightSeconds = 60;

// A small generator: there is one for each task.
std::function<double()> SystemRandom() {
    return [engine = std::minstd_rand(std::random_device()())]() mutable {
        return std::generate_canonical<double, 32>(engine);
    };
}

}  // namespace

int64_t SystemClock::Now() const {
    return time(nullptr);
}

int64_t SystemClock::Elapsed() const {
    struct timespec since_boot = {};
    clock_gettime(CLOCK_BOOTTIME, &since_boot);
    return int64_t{since_boot.tv_sec} * 1000 + since_boot.tv_nsec / 1000000;
}

TaskPlan::TaskPlan(const Clock& clock, const ZEL::Schedule& schedule, int64_t checked_until,
                   std::function<double()> random)
    : clock_(clock),
      schedule_(schedule),
      checked_until_(checked_until),
      random_(random ? std::move(random) : SystemRandom()) {}

std::optional<int64_t> TaskPlan::NextRun() const {
    if (schedule_.GetMode() == ZEL::SCHD_MODE_REALTIME ||
        checked_until_ > std::numeric_limits<long>::max()) {
        return std::nullopt;
    }
    if (next_after_ != checked_until_) {
        next_ = Reckon();
        next_after_ = checked_until_;
    }
    return next_;
}

std::optional<int64_t> TaskPlan::Reckon() const {
    // A clock that stood before 1970 has no runs, but those since then are not lost.
    const int64_t reference = std::max<int64_t>(checked_until_, 0);
    const long next = schedule_.GetNextScheduledSeconds(static_cast<long>(reference));
    return next > 0 ? std::optional<int64_t>(next) : std::nullopt;
}

bool TaskPlan::ScheduleDue() {
    const int64_t now = clock_.Now();
    if (WasSetBack(now)) {
        checked_until_ = now;
    }
    const std::optional<int64_t> next = NextRun();
    return next && *next <= now;
}

void TaskPlan::ScheduleTaken() {
    const int64_t now = clock_.Now();
    if (now > checked_until_ || WasSetBack(now)) {
        checked_until_ = now;
    }
}

bool TaskPlan::WasSetBack(int64_t now) const {
    return checked_until_ > now + kSetRightSeconds;
}

void TaskPlan::Failed(const RetryDelays& delays) {
    retry_.Failed(clock_.Elapsed(), delays, random_());
}

}  // namespace zel_daemon
