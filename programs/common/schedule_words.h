// Schedules in people's words: "weekly mon,thu 02:30, 3 more every 1h30m".
#pragma once

#include <optional>
#include <string>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"

namespace programs {

/// What a person says of a schedule. What is not said stays unset.
struct ScheduleWords {
    bool manual = false;
    bool on_change = false;
    std::optional<std::string> weekly;   ///< "mon,thu", "monday", "daily", "weekdays", "weekends"
    std::optional<std::string> monthly;  ///< a day of the month
    std::optional<std::string> yearly;   ///< MM-DD
    std::optional<std::string> once;     ///< YYYY-MM-DD
    std::optional<std::string> at;       ///< HH:MM, the first run of a day
    std::optional<std::string> every;    ///< "90m", "1h30m", "2h": between the runs of a day
    std::optional<unsigned int> times;   ///< runs of a day after the first
};

/// Adds the keys of a task's settings that say the same; what is not said has none. Throws Failure
/// (kUsage), in terms of the options that carry the words.
void SayWords(const ScheduleWords& words, ZEL::PObject& settings);

// What belongs together in a schedule, whoever says it: each gives what is wrong, or nothing.

/// `settings` are a task's after `said` has been put into them. A day's repeats need a count and a
/// period: one that is said alone has to find the other there. A count of 0 takes the period away.
std::string SettleSchedule(const ZEL::PObject& said, ZEL::PObject& settings);
/// Whether all runs of a day fall on that day.
std::string FaultOfTimes(const ZEL::Schedule& schedule);

/// A schedule in a person's words.
std::string DescribeSchedule(const ZEL::Schedule& schedule);

/// When it runs in a month or year without its day; empty when each has it.
std::string DescribeMissingDay(const ZEL::Schedule& schedule);

struct CalendarDate {
    int year;
    int month;  ///< 1 to 12
    int day;
};

struct TimeOfDay {
    int hours;
    int minutes;
};

/// "YYYY-MM-DD", a date of the calendar since 1970; nothing for any other text.
std::optional<CalendarDate> ParseDate(const std::string& text);

/// "HH:MM", from 00:00 to 23:59; nothing for any other text.
std::optional<TimeOfDay> ParseTimeOfDay(const std::string& text);

}  // namespace programs
