// Schedules in plain words: "weekly mon,thu 02:30, 3 more every 1h30m".
#pragma once

#include <optional>
#include <string>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"

namespace programs {

/// A schedule as given on the command line. Options that were not given are unset.
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

/// Adds the settings of a task that mean the same; unset words add none. Throws Failure (kUsage),
/// with a text that refers to the options.
void SayWords(const ScheduleWords& words, ZEL::PObject& settings);

// Consistency of a schedule, however it was given: each function returns what is wrong, or nothing.

/// `settings` are a task's after `said` was merged into them. Repeated runs need both a count and a
/// period: if only one was given, the other must be there already. A count of 0 removes the period.
std::string SettleSchedule(const ZEL::PObject& said, ZEL::PObject& settings);
/// Checks that all runs of a day are before midnight.
std::string FaultOfTimes(const ZEL::Schedule& schedule);

/// A schedule in a person's words.
std::string DescribeSchedule(const ZEL::Schedule& schedule);

/// What happens in a month or year that lacks the schedule's day; empty when none does.
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

/// "YYYY-MM-DD", a valid date since 1970; nothing for any other text.
std::optional<CalendarDate> ParseDate(const std::string& text);

/// "HH:MM", from 00:00 to 23:59; nothing for any other text.
std::optional<TimeOfDay> ParseTimeOfDay(const std::string& text);

}  // namespace programs
