// Schedules in people's words: "weekly mon,thu 02:30, 3 more every 1h30m".
#pragma once

#include <optional>
#include <string>

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

    bool Any() const;
};

/// Changes `schedule` to what the words say and leaves the rest of it. Empty, or what is wrong, in
/// terms of the options that carry the words; the schedule then counts no more.
std::string ApplyWords(const ScheduleWords& words, ZEL::Schedule& schedule);

/// The reverse, for a person.
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
