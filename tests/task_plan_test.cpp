#include "programs/zel_daemon/task_plan.h"

#include "tests/support/schedules.h"
#include "tests/support/testing.h"

namespace {

using namespace test;
using namespace testing;
using zel_daemon::TaskPlan;

struct TestClock : zel_daemon::Clock {
    explicit TestClock(const char* start) : now(Utc(start)) {}
    int64_t Now() const override { return now; }
    int64_t Elapsed() const override { return elapsed; }
    void Pass(int64_t seconds) {
        now += seconds;
        elapsed += seconds * 1000;
    }

    int64_t now;
    int64_t elapsed = 0;
};

// Time passes second by second; each run that is due is taken. When runs were taken, in UTC.
std::vector<std::string> Live(TestClock& clock, TaskPlan& plan, int64_t seconds) {
    std::vector<std::string> runs;
    for (int64_t i = 0; i < seconds; ++i) {
        if (plan.ScheduleDue()) {
            runs.push_back(UtcText(clock.now));
            plan.ScheduleTaken();
            EXPECT_FALSE(plan.ScheduleDue());
        }
        clock.Pass(1);
    }
    return runs;
}

TEST(TaskPlan, MissedRunsAreMadeUpForOnce) {
    SetZone("UTC");
    TestClock clock("2015-03-20 12:00:00");
    struct {
        ZEL::Schedule schedule;
        const char* checked_until;
        std::vector<std::string> runs;
    } const cases[] = {
        {Make("weekly", "", 8),
         "2015-03-10 08:00:00",
         {"2015-03-20 12:00:00", "2015-03-21 08:00:00"}},
        {Make("weekly", "", 8), "2015-03-20 08:00:00", {"2015-03-21 08:00:00"}},
        {Make("weekly", "", 11, 1800, 3),
         "2015-03-20 11:00:00",
         {"2015-03-20 12:00:00", "2015-03-20 12:30:00", "2015-03-21 11:00:00",
          "2015-03-21 11:30:00"}},
        {Make("once", "2015-03-15", 8), "2015-03-10 00:00:00", {"2015-03-20 12:00:00"}},
        {Make("once", "2015-03-15", 8), "2015-03-20 12:00:00", {}},
        {Make("realtime", "", 8), "2015-03-10 00:00:00", {}},
        {Make("weekly", "", 8),
         "1969-12-31 23:59:59",
         {"2015-03-20 12:00:00", "2015-03-21 08:00:00"}},
    };
    for (const auto& c : cases) {
        TestClock now = clock;
        TaskPlan plan(now, c.schedule, Utc(c.checked_until));
        EXPECT_EQ(plan.NextRun().has_value(), !c.runs.empty());
        EXPECT_EQ(Live(now, plan, 86400), c.runs);
        // What is stored is enough to go on from.
        TaskPlan again(now, c.schedule, plan.CheckedUntil());
        EXPECT_EQ(again.NextRun(), plan.NextRun());
    }
}

TEST(TaskPlan, AfterAJumpTheScheduleGoesOnFromTheTimeThatIsShown) {
    SetZone("UTC");
    TestClock clock("2015-03-20 07:59:00");
    TaskPlan plan(clock, Make("weekly", "", 8, 3600, 1), clock.now);
    EXPECT_THAT(Live(clock, plan, 120), ElementsAre("2015-03-20 08:00:00"));
    clock.now = Utc("2020-01-01 00:00:00");
    EXPECT_THAT(Live(clock, plan, 9 * 3600),
                ElementsAre("2020-01-01 00:00:00", "2020-01-01 08:00:00"));
    clock.now = Utc("2015-03-20 08:30:00");
    EXPECT_THAT(Live(clock, plan, 86400),
                ElementsAre("2015-03-20 09:00:00", "2015-03-21 08:00:00"));
    clock.now = -3600;  // an empty clock battery
    EXPECT_THAT(Live(clock, plan, 10), IsEmpty());
    clock.now = Utc("2015-03-21 08:30:00");
    EXPECT_THAT(Live(clock, plan, 60), ElementsAre("2015-03-21 08:30:00"));
    // Set right by a few seconds, just after a run: it is not made twice, the next one is made.
    clock.now = Utc("2015-03-21 08:59:59");
    EXPECT_THAT(Live(clock, plan, 2), ElementsAre("2015-03-21 09:00:00"));
    clock.now -= 20;
    plan.ScheduleTaken();  // by a person's run, say
    EXPECT_THAT(Live(clock, plan, 86400), ElementsAre("2015-03-22 08:00:00"));
}

TEST(TaskPlan, AChangedTimeZoneHoldsAtOnce) {
    SetZone("UTC");
    TestClock clock("2015-03-20 07:00:00");
    TaskPlan plan(clock, Make("weekly", "", 8), clock.now);
    EXPECT_EQ(UtcText(plan.NextRun().value_or(0)), "2015-03-20 08:00:00");
    SetZone("America/New_York");
    plan.ZoneChanged();
    EXPECT_EQ(UtcText(plan.NextRun().value_or(0)), "2015-03-20 12:00:00");
    SetZone("Asia/Tokyo");  // where it is four in the afternoon
    plan.ZoneChanged();
    EXPECT_THAT(Live(clock, plan, 86400), ElementsAre("2015-03-20 23:00:00"));
}

// From noon before the night in which the clocks are changed, to two nights later. An hour that
// comes twice has its run twice; of a day's repeats one falls away or comes once more, since the
// schedule counts them from the start as the time now in force has it.
TEST(TaskPlan, ANightInWhichClocksAreChangedHasItsRun) {
    SetZone("Europe/Berlin");
    struct {
        const char* start;
        ZEL::Schedule schedule;
        std::vector<std::string> runs;
    } const cases[] = {
        {"2025-03-29 12:00:00",
         Make("weekly", "", 2),
         {"2025-03-30 01:00:00", "2025-03-31 00:00:00"}},
        {"2025-03-29 12:00:00",
         Make("weekly", "", 1, 3600, 2),
         {"2025-03-30 00:00:00", "2025-03-30 01:00:00", "2025-03-30 23:00:00",
          "2025-03-31 00:00:00", "2025-03-31 01:00:00"}},
        {"2025-10-25 12:00:00",
         Make("weekly", "", 2),
         {"2025-10-26 00:00:00", "2025-10-26 01:00:00", "2025-10-27 01:00:00"}},
        {"2025-10-25 12:00:00",
         Make("weekly", "", 1, 3600, 2),
         {"2025-10-25 23:00:00", "2025-10-26 00:00:00", "2025-10-26 01:00:00",
          "2025-10-26 02:00:00", "2025-10-27 00:00:00", "2025-10-27 01:00:00"}},
    };
    for (const auto& c : cases) {
        TestClock clock(c.start);
        TaskPlan plan(clock, c.schedule, clock.now);
        EXPECT_EQ(Live(clock, plan, 38 * 3600), c.runs);
    }
}

TEST(TaskPlan, RetriesComeLaterAndLaterAndNotAllAtTheSameMoment) {
    SetZone("UTC");
    TestClock clock("2015-03-20 12:00:00");
    double random = 0.5;
    TaskPlan plan(clock, Make("manual", "", 0), clock.now, [&] { return random; });
    EXPECT_FALSE(plan.RetryWaiting() || plan.RetryDue() || plan.UntilRetry());
    const std::pair<double, int64_t> tries[] = {
        {0.5, 10000},   {0.5, 20000},  {0, 32000},     {1, 96000},   {0.25, 144000},
        {0.5, 320000},  {0.5, 640000}, {0.5, 1280000}, {0, 2048000}, {0.5, 3600000},
        {0.5, 3600000}, {1, 4320000},  {0, 2880000},
    };
    for (const auto& [chance, delay] : tries) {
        random = chance;
        plan.Failed();
        EXPECT_EQ(plan.UntilRetry(), delay);
        clock.now -= 1000000;  // the clock that people see does not matter
        clock.elapsed += delay - 1;
        EXPECT_TRUE(plan.RetryWaiting() && !plan.RetryDue());
        clock.elapsed += 1000;
        EXPECT_TRUE(plan.RetryDue());
        EXPECT_EQ(plan.UntilRetry(), 0);
    }
    EXPECT_EQ(plan.Failures(), std::size(tries));
    plan.Settled();
    EXPECT_FALSE(plan.RetryWaiting() || plan.RetryDue());
    random = 0.5;
    plan.Failed();
    EXPECT_EQ(plan.UntilRetry(), 10000);
}

TEST(TaskPlan, WhatAlwaysFailsIsNotTriedAllTheTime) {
    SetZone("UTC");
    TestClock clock("2015-03-20 00:00:00");
    TaskPlan plan(clock, Make("weekly", "", 0, 900, 95), clock.now - 86400);
    int runs = 0;
    for (int i = 0; i < 86400; ++i, clock.Pass(1)) {
        const bool due = plan.ScheduleDue();
        if (due || plan.RetryDue()) {
            if (due) {
                plan.ScheduleTaken();
            }
            plan.Failed();
            ++runs;
        }
    }
    EXPECT_GE(runs, 96);       // the schedule's own
    EXPECT_LE(runs, 96 + 10);  // and the tries until the longest wait is longer than the period
}

TEST(TaskPlan, TheSystemsClocksGoOn) {
    const zel_daemon::SystemClock clock;
    EXPECT_NEAR(static_cast<double>(clock.Now()), static_cast<double>(time(nullptr)), 1);
    const int64_t start = clock.Elapsed();
    usleep(20000);
    EXPECT_NEAR(static_cast<double>(clock.Elapsed() - start), 20, 15);
    // Unlike the tests above, two tasks of one machine do not retry at the same moment.
    TaskPlan one(clock, ZEL::Schedule(), 0), other(clock, ZEL::Schedule(), 0);
    for (int i = 0; i < 10; ++i) {
        one.Failed(), other.Failed();
    }
    EXPECT_NE(*one.UntilRetry() / 50, *other.UntilRetry() / 50);
}

}  // namespace
