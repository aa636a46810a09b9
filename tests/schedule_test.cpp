#include <bitset>

#include "tests/support/log_capture.h"
#include "tests/support/schedules.h"
#include "tests/support/testing.h"

namespace {

using namespace testing;
using ZEL::Schedule;
using namespace test;

TEST(Schedule, SettersKeepModeAndWeekSound) {
    Schedule schedule;
    schedule.SetModeByStr("Once");
    EXPECT_EQ(schedule.GetModeStr(), "manual");
    schedule.SetMode(static_cast<ZEL::SCHD_MODE>(0xffffffff));
    EXPECT_EQ(schedule.GetModeStr(), "weekly");

    for (const auto& [given, kept] : {std::pair("0x00000abc", "0100000"),
                                      {"1000001", "1000001"},
                                      {"0000000", "1111111"},
                                      {"00000001", "1111111"},
                                      {"", "1111111"}}) {
        schedule.SetWeekSchedule(given);
        EXPECT_EQ(schedule.GetWeekSchedule(), kept) << given;
    }
    EXPECT_EQ(ZEL::GetDaysToNextSync(2, "0100000"), 6);
    EXPECT_EQ(ZEL::GetDaysToNextSync(UINT_MAX, "0000100"), 1);
    EXPECT_EQ(ZEL::GetDaysToNextSync(0, "xxxxxxx"), -1);
    EXPECT_EQ(ZEL::GetDaysToNextSync(6, ""), -1);
}

TEST(Schedule, ValidateFindsWhatHasNoRun) {
    SetZone("Europe/Berlin");
    const test::LogCapture quiet(0);
    const std::function<void(Schedule&)> valid[] = {
        [](Schedule& s) { s = Make("weekly", "", 23), s.SetStartMinute(59); },
        [](Schedule& s) { s.SetPeriod(86399); },
        [](Schedule& s) { s = Make("", "", 0, 900, 95); },
        [](Schedule& s) { s = Make("weekly", "", 23, 1800, 1); },
        [](Schedule& s) { s = Make("once", "2016-2-29", 2); },
    };
    const std::function<void(Schedule&)> faulty[] = {
        [](Schedule& s) { s.SetStartHour(24); },
        [](Schedule& s) { s.SetStartMinute(60); },
        [](Schedule& s) { s.SetStartMinute(INT_MIN); },
        [](Schedule& s) { s.SetPeriod(86400); },
        [](Schedule& s) { s.SetPeriod(LONG_MAX / 3600 + 1, 0); },
        [](Schedule& s) { s = Make("", "", 0, 1, 96); },
        [](Schedule& s) { s.SetRepeatTimesInDay(-1); },
        [](Schedule& s) { s = Make("weekly", "", 23, 1800, 2); },
        [](Schedule& s) { s.SetBeginYear(INT_MIN); },
        [](Schedule& s) { s = Make("once", "2015-2-29", 0); },
        [](Schedule& s) { const Schedule taken = std::move(s); },
        [](Schedule& s) { s.SetMode(static_cast<ZEL::SCHD_MODE>(6)); },
    };
    const auto is_valid = [](const std::function<void(Schedule&)>& change) {
        Schedule schedule;
        change(schedule);
        return schedule.Validate();
    };
    EXPECT_THAT(valid, Each(ResultOf(is_valid, true)));
    EXPECT_THAT(faulty, Each(ResultOf(is_valid, false)));
}

TEST(Schedule, NextRun) {
    const char* const berlin = "Europe/Berlin";
    const Schedule daily = Make("weekly", "1111111", 8);
    const Schedule fifth = Make("monthly", "2014-01-05", 8);
    const Schedule last_day = Make("monthly", "2014-01-31", 8);
    const Schedule leap_day = Make("yearly", "2016-02-29", 8);
    const Schedule once = Make("once", "2015-04-20", 8, 60, 1);
    struct {
        const char* zone;
        const Schedule& schedule;
        const char *from, *next;  // in UTC; next is the epoch where there is none
    } const cases[] = {
        {"UTC", last_day, "2015-04-15 12:00:00", "2015-05-01 08:00:00"},
        {"UTC", last_day, "2015-05-01 08:00:00", "2015-05-31 08:00:00"},
        {"UTC", leap_day, "2015-02-10 00:00:00", "2015-03-01 08:00:00"},
        {"UTC", leap_day, "2015-03-01 08:00:00", "2016-03-01 08:00:00"},  // a year after that day
        {"UTC", leap_day, "2016-01-01 00:00:00", "2016-02-29 08:00:00"},
        {"UTC", once, "2015-04-20 08:01:00", "1970-01-01 00:00:00"},
        // A start is read with the daylight flag that the search reaches its day with.
        {berlin, daily, "2025-03-29 08:00:00", "2025-03-30 07:00:00"},  // 09:00 in summer
        {berlin, daily, "2025-03-30 07:00:00", "2025-03-31 06:00:00"},
        {berlin, daily, "2025-10-25 07:00:00", "2025-10-26 06:00:00"},  // 07:00 in winter
        {berlin, daily, "2025-10-26 06:00:00", "2025-10-26 07:00:00"},  // 08:00, once more
        {berlin, daily, "2025-10-26 07:00:00", "2025-10-27 07:00:00"},
        {berlin, fifth, "2025-10-20 10:00:00", "2025-11-05 06:00:00"},  // from 5 October, in summer
        {berlin, fifth, "2025-11-01 10:00:00", "2025-11-05 07:00:00"},
        {berlin, Make("yearly", "2014-06-15", 8), "2015-03-15 00:00:00", "2015-06-15 06:00:00"},
        {"America/New_York", daily, "2025-03-08 13:00:00", "2025-03-09 13:00:00"},
        {berlin, Make("weekly", "1", 2), "2025-03-29 23:30:00", "2025-03-30 01:00:00"},  // no 02:00
    };
    for (const auto& c : cases) {
        SetZone(c.zone);
        EXPECT_EQ(UtcText(c.schedule.GetNextScheduledSeconds(Utc(c.from))), c.next)
            << c.schedule.GetModeStr() << " from " << c.from;
    }
    EXPECT_EQ(Make("realtime", "", 99).GetNextScheduledSeconds(41), 42);
}

TEST(Schedule, NextRunEndsWhateverItIsGiven) {
    SetZone("UTC");
    const test::LogCapture quiet(0);
    for (const char* mode : {"manual", "realtime", "weekly", "once"}) {
        EXPECT_EQ(Make(mode, "", 0).GetNextScheduledSeconds(-1), -1);
    }
    EXPECT_EQ(Make("realtime", "", 0).GetNextScheduledSeconds(LONG_MAX), -1);
    EXPECT_EQ(Make("weekly", "", 0, 60, -1).GetNextScheduledSeconds(1), -1);
    Schedule schedule = Make("weekly", "", 0);
    const Schedule taken = std::move(schedule);
    // NOLINTNEXTLINE(bugprone-use-after-move,clang-analyzer-cplusplus.Move): a week without days
    EXPECT_EQ(schedule.GetNextScheduledSeconds(1), -1);
    schedule.SetMode(static_cast<ZEL::SCHD_MODE>(9));
    EXPECT_EQ(schedule.GetNextScheduledSeconds(1), -1);
    EXPECT_EQ(Make("once", "1950-01-01", 0).GetNextScheduledSeconds(3723), -1);
    EXPECT_EQ(Make("once", "1970-01-01", -24).GetNextScheduledSeconds(0), 0);
    const long next = Make("weekly", "", 8).GetNextScheduledSeconds(INT_MAX);
    EXPECT_EQ(next, sizeof(long) == 8 ? Utc("2038-01-19 08:00:00") : -1);
}

// The first run after `reference`, by a look at every minute of two years; 0 where there is none.
// Only for days that every month has, and where clocks are never changed.
long WalkToNextRun(const Schedule& schedule, long reference) {
    const long end = reference + 2 * 366 * 86400L;
    for (long time = reference - reference % 60 + 60; time < end; time += 60) {
        struct tm now = {};
        const time_t moment = time;
        localtime_r(&moment, &now);
        const unsigned int mode = schedule.GetMode();
        const bool run_day =
            mode == ZEL::SCHD_MODE_WEEKLY
                ? schedule.GetWeekSchedule()[static_cast<size_t>(now.tm_wday)] == '1'
                : now.tm_mday == schedule.GetBeginDay() &&
                      (mode == ZEL::SCHD_MODE_MONTHLY ||
                       now.tm_mon + 1 == schedule.GetBeginMonth()) &&
                      (mode != ZEL::SCHD_MODE_ONCE ||
                       now.tm_year + 1900 == schedule.GetBeginYear());
        if (!run_day) {
            time += (23 - now.tm_hour) * 3600 + (59 - now.tm_min) * 60;
            continue;
        }
        const long since_start = (now.tm_hour - schedule.GetStartHour()) * 3600L +
                                 (now.tm_min - schedule.GetStartMinute()) * 60L;
        const long period = schedule.GetPeriodSeconds();
        if (since_start == 0 || (since_start > 0 && period > 0 && since_start % period == 0 &&
                                 since_start / period <= schedule.GetRepeatTimesInDay())) {
            return time;
        }
    }
    return 0;
}

TEST(Schedule, AgreesWithAWalkOverTheCalendar) {
    SetZone("Asia/Kathmandu");  // a quarter of an hour beside the others
    const test::LogCapture quiet(0);
    std::mt19937 random(20140101);
    const auto pick = [&](int from, int to) {
        return std::uniform_int_distribution<int>(from, to)(random);
    };
    int runs = 0;
    for (int i = 0; i < 2000; ++i) {
        const std::string date = std::to_string(2015 + i / 100) + "-" +
                                 std::to_string(pick(1, 12)) + "-" + std::to_string(pick(1, 28));
        Schedule schedule = Make("", date.c_str(), pick(0, 23), pick(1, 300) * 60, pick(0, 5));
        schedule.SetMode(static_cast<ZEL::SCHD_MODE>(pick(2, 5)));
        schedule.SetWeekSchedule(
            std::bitset<7>(static_cast<unsigned int>(pick(1, 127))).to_string());
        schedule.SetStartMinute(pick(0, 59));
        struct tm begin = schedule.GetScheduleBegin();
        const long reference = static_cast<long>(mktime(&begin)) + pick(-40 * 86400, 3 * 86400);
        if (schedule.Validate()) {
            const long walked = WalkToNextRun(schedule, reference);
            ASSERT_EQ(schedule.GetNextScheduledSeconds(reference), walked)
                << schedule.GetModeStr() << " " << date << " from " << UtcText(reference);
            runs += walked != 0;
        }
    }
    EXPECT_GT(runs, 500);
}

}  // namespace
