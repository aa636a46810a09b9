#pragma once

#include "programs/zel_daemon/task_plan.h"
#include "tests/support/schedules.h"

namespace test {

/// A clock that goes only when it is told to.
struct TestClock : zel_daemon::Clock {
    explicit TestClock(const char* start) { Set(start); }
    int64_t Now() const override { return offset + elapsed / 1000; }
    int64_t Elapsed() const override { return elapsed; }
    /// Somebody sets it.
    void Set(const char* utc) { offset = Utc(utc) - elapsed / 1000; }

    int64_t elapsed = 1000;  // since the machine's start
    int64_t offset = 0;
};

}  // namespace test
