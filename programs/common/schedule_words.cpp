#include "programs/common/schedule_words.h"

#include <algorithm>
#include <cstdio>
#include <iterator>
#include <vector>

#include "ZEL/rsyncer.h"
#include "base/text.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"

namespace programs {

namespace {

using ZEL::PObject;

constexpr const char* kDays[] = {"sunday",   "monday", "tuesday", "wednesday",
                                 "thursday", "friday", "saturday"};
constexpr size_t kShortDay = 3;  // letters

struct NamedWeek {
    const char* word;
    const char* week;  // Sunday first
};
constexpr NamedWeek kNamedWeeks[] = {
    {"daily", "1111111"}, {"weekdays", "0111110"}, {"weekends", "1000001"}};

// A leap year, and its first month with 31 days: placeholders for the year or month of a schedule
// that has none.
constexpr int kLeapYear = 2016;
constexpr int kJanuary = 1;

constexpr int kLastMinuteOfDay = 24 * 60 - 1;
constexpr long kMaxTimes = 95;  // limit of the library: a run every quarter of an hour

constexpr char kTimesNeedDays[] =
    "--at, --every and --times go with --weekly, --monthly, --yearly or --once";
constexpr char kEveryAlone[] = "--every needs --times N: how often a day's run is repeated";

std::string Quoted(const std::string& text) {
    return "'" + Printable(text) + "'";
}

// The decimal numbers between `separator`s; `digits` has the maximum number of digits of each.
// Empty for any other text.
std::vector<int> Numbers(const std::string& text, char separator,
                         const std::vector<size_t>& digits) {
    std::vector<std::string> pieces;
    ZEL::SplitStringByChars(text, std::string(1, separator), pieces);
    std::vector<int> numbers;
    for (size_t i = 0; i < pieces.size() && pieces.size() == digits.size(); ++i) {
        const auto number = base::ParseNumber(pieces[i], 9999);
        if (!number || pieces[i].size() > digits[i]) {
            return {};
        }
        numbers.push_back(static_cast<int>(*number));
    }
    return numbers;
}

bool IsDate(int year, int month, int day) {
    static constexpr int kDaysOfMonth[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    if (year < 1970 || month < 1 || month > 12 || day < 1) {
        return false;
    }
    const bool leap = year % 4 == 0 && (year % 100 != 0 || year % 400 == 0);
    return day <= kDaysOfMonth[month - 1] + (leap && month == 2 ? 1 : 0);
}

// Converts "90m", "2h", "1h30m" into minutes; nothing for any other text, 0, or a day or more.
std::optional<int> ParsePeriod(const std::string& text) {
    const size_t h = text.find('h');
    const std::string hours = h == std::string::npos ? "0" : text.substr(0, h);
    std::string minutes = h == std::string::npos ? text : text.substr(h + 1);
    if (minutes.empty() && h != std::string::npos) {
        minutes = "0m";
    }
    if (minutes.size() < 2 || minutes.back() != 'm') {
        return std::nullopt;
    }
    minutes.pop_back();
    const auto whole = base::ParseNumber(hours, 23);
    const auto rest = base::ParseNumber(minutes, kLastMinuteOfDay);
    if (!whole || !rest) {
        return std::nullopt;
    }
    const int period = static_cast<int>(*whole * 60 + *rest);
    return period == 0 || period > kLastMinuteOfDay ? std::nullopt : std::optional<int>(period);
}

std::string DescribePeriod(long seconds) {
    const long hours = seconds / 3600;
    const long minutes = seconds / 60 % 60;
    std::string text = hours > 0 ? std::to_string(hours) + "h" : "";
    if (minutes > 0 || hours == 0) {
        text += std::to_string(minutes) + "m";
    }
    return text;
}

[[noreturn]] void Refuse(const std::string& text) {
    throw Failure(FailureKind::kUsage, text);
}

std::string ParseWeek(const std::string& words) {
    std::vector<std::string> pieces;
    ZEL::SplitStringByChars(base::Lower(words), ",", pieces);
    std::string week = "0000000";
    for (const std::string& piece : pieces) {
        const auto* const named =
            std::find_if(std::begin(kNamedWeeks), std::end(kNamedWeeks),
                         [&](const NamedWeek& entry) { return piece == entry.word; });
        const auto* const day =
            std::find_if(std::begin(kDays), std::end(kDays), [&](const std::string& name) {
                return piece == name || piece == name.substr(0, kShortDay);
            });
        if (named != std::end(kNamedWeeks)) {
            for (size_t i = 0; i < week.size(); ++i) {
                week[i] = std::max(week[i], named->week[i]);
            }
        } else if (day != std::end(kDays)) {
            week[static_cast<size_t>(day - std::begin(kDays))] = '1';
        } else {
            Refuse("--weekly: " + Quoted(piece) +
                   " is no day: give days as in mon,thu or monday, or daily, weekdays, weekends");
        }
    }
    return week;
}

void SayBegin(const CalendarDate& date, PObject& settings) {
    settings["schedule_begin_year"] = date.year;
    settings["schedule_begin_month"] = date.month;
    settings["schedule_begin_day"] = date.day;
}

void SayStart(const TimeOfDay& start, PObject& settings) {
    settings["schedule_begin_hour"] = start.hours;
    settings["schedule_begin_min"] = start.minutes;
}

void SayPeriod(int minutes, PObject& settings) {
    settings["period_hour"] = minutes / 60;
    settings["period_minute"] = minutes % 60;
}

void SayMode(ZEL::SCHD_MODE mode, PObject& settings) {
    settings["schedule_mode"] = static_cast<int>(mode);
}

// Sets the mode and its days.
void SayDays(const ScheduleWords& words, PObject& settings) {
    const int modes = int{words.manual} + int{words.on_change} + int{words.weekly.has_value()} +
                      int{words.monthly.has_value()} + int{words.yearly.has_value()} +
                      int{words.once.has_value()};
    if (modes > 1) {
        Refuse("give only one of --manual, --on-change, --weekly, --monthly, --yearly and --once");
    }
    if (words.manual || words.on_change) {
        SayMode(words.manual ? ZEL::SCHD_MODE_MANUAL : ZEL::SCHD_MODE_REALTIME, settings);
        SayStart({0, 0}, settings);
        settings["repeat_times_in_day"] = 0;
    } else if (words.weekly) {
        SayMode(ZEL::SCHD_MODE_WEEKLY, settings);
        settings["week_schd"] = ParseWeek(*words.weekly);
    } else if (words.monthly) {
        const auto day = base::ParseNumber(*words.monthly, 31);
        if (!day || *day == 0) {
            Refuse("--monthly: " + Quoted(*words.monthly) + " is no day of a month: give 1 to 31");
        }
        SayMode(ZEL::SCHD_MODE_MONTHLY, settings);
        SayBegin({kLeapYear, kJanuary, static_cast<int>(*day)}, settings);
    } else if (words.yearly) {
        const std::vector<int> date = Numbers(*words.yearly, '-', {2, 2});
        if (date.empty() || !IsDate(kLeapYear, date[0], date[1])) {
            Refuse("--yearly: " + Quoted(*words.yearly) + " is no date MM-DD, as in 03-31");
        }
        SayMode(ZEL::SCHD_MODE_YEARLY, settings);
        SayBegin({kLeapYear, date[0], date[1]}, settings);
    } else if (words.once) {
        const auto date = ParseDate(*words.once);
        if (!date) {
            Refuse("--once: " + Quoted(*words.once) + " is no date YYYY-MM-DD, as in 2026-03-31");
        }
        SayMode(ZEL::SCHD_MODE_ONCE, settings);
        SayBegin(*date, settings);
    }
}

void SayRepeats(const ScheduleWords& words, PObject& settings) {
    if (words.every) {
        const auto period = ParsePeriod(*words.every);
        if (!period) {
            Refuse("--every: " + Quoted(*words.every) +
                   " is no time span: give hours and minutes, as in 90m, 2h or 1h30m");
        }
        if (words.times && *words.times == 0) {
            Refuse(kEveryAlone);
        }
        SayPeriod(*period, settings);
    }
    if (words.times) {
        if (*words.times > kMaxTimes) {
            Refuse("--times: a day has at most 95 runs after the first");
        }
        settings["repeat_times_in_day"] = *words.times;
    }
}

std::string DescribeDays(const ZEL::Schedule& schedule) {
    char text[64] = "";
    switch (schedule.GetMode()) {
        case ZEL::SCHD_MODE_MONTHLY:
            snprintf(text, sizeof text, "monthly %d", schedule.GetBeginDay());
            break;
        case ZEL::SCHD_MODE_YEARLY:
            snprintf(text, sizeof text, "yearly %02d-%02d", schedule.GetBeginMonth(),
                     schedule.GetBeginDay());
            break;
        case ZEL::SCHD_MODE_ONCE:
            snprintf(text, sizeof text, "once %04d-%02d-%02d", schedule.GetBeginYear(),
                     schedule.GetBeginMonth(), schedule.GetBeginDay());
            break;
        default: {
            const std::string week = schedule.GetWeekSchedule();
            for (const NamedWeek& named : kNamedWeeks) {
                if (week == named.week) {
                    return named.word;
                }
            }
            std::string days;
            for (size_t i = 0; i < std::size(kDays) && i < week.size(); ++i) {
                // Weeks start on Monday here, as people expect.
                const size_t day = (i + 1) % std::size(kDays);
                if (week[day] != '0') {
                    days += (days.empty() ? "" : ",") + std::string(kDays[day], kShortDay);
                }
            }
            return "weekly " + days;
        }
    }
    return text;
}

}  // namespace

void SayWords(const ScheduleWords& words, PObject& settings) {
    SayDays(words, settings);
    if ((words.manual || words.on_change) && (words.at || words.every || words.times)) {
        Refuse(kTimesNeedDays);
    }
    if (words.at) {
        const auto start = ParseTimeOfDay(*words.at);
        if (!start) {
            Refuse("--at: " + Quoted(*words.at) + " is no time HH:MM from 00:00 to 23:59");
        }
        SayStart(*start, settings);
    }
    SayRepeats(words, settings);
}

std::string SettleSchedule(const PObject& said, PObject& settings) {
    const PObject& now = settings;
    const bool says_period = said["period_hour"].asBool() || said["period_minute"].asBool();
    const bool says_times = said["repeat_times_in_day"].asBool();
    const bool says_start =
        said["schedule_begin_hour"].asBool() || said["schedule_begin_min"].asBool();
    if ((says_period || says_times || says_start) && !said.hasMember("schedule_mode") &&
        now["schedule_mode"].asUInt32() <= ZEL::SCHD_MODE_REALTIME) {
        return kTimesNeedDays;
    }
    if (says_period && !now["repeat_times_in_day"].asBool() &&
        !said.hasMember("repeat_times_in_day")) {
        return kEveryAlone;
    }
    const bool has_period = now["period_hour"].asBool() || now["period_minute"].asBool();
    if (says_times && !has_period && !said.hasMember("period_hour")) {
        return "--times needs --every: the time between two runs, as in 1h30m";
    }
    if (said.hasMember("repeat_times_in_day") && !says_times && !says_period) {
        SayPeriod(0, settings);
    }
    return "";
}

std::string FaultOfTimes(const ZEL::Schedule& schedule) {
    // A schedule from elsewhere may contain any numbers; the bounds prevent an overflow.
    const long period = std::clamp(schedule.GetPeriodSeconds() / 60, 0L, kLastMinuteOfDay + 1L);
    const long times = std::clamp(schedule.GetRepeatTimesInDay(), 0L, kMaxTimes + 1L);
    const long start = std::clamp(schedule.GetStartHour(), 0, 24) * 60L +
                       std::clamp(schedule.GetStartMinute(), 0, 60);
    const long last = start + period * times;  // minutes
    return last <= kLastMinuteOfDay
               ? ""
               : "the last of the day's runs would be " + DescribePeriod(last * 60) +
                     " after midnight, on another day: choose an earlier --at, a shorter --every "
                     "or fewer --times";
}

std::string DescribeSchedule(const ZEL::Schedule& schedule) {
    if (schedule.GetMode() == ZEL::SCHD_MODE_MANUAL) {
        return "manual";
    }
    if (schedule.GetMode() == ZEL::SCHD_MODE_REALTIME) {
        return "on change";
    }
    char start[32];
    snprintf(start, sizeof start, " %02d:%02d", schedule.GetStartHour(), schedule.GetStartMinute());
    std::string text = DescribeDays(schedule) + start;
    if (schedule.GetRepeatTimesInDay() > 0) {
        text += ", " + std::to_string(schedule.GetRepeatTimesInDay()) + " more every " +
                DescribePeriod(schedule.GetPeriodSeconds());
    }
    return text;
}

std::string DescribeMissingDay(const ZEL::Schedule& schedule) {
    const long day = schedule.GetBeginDay();
    if (schedule.GetMode() == ZEL::SCHD_MODE_YEARLY && schedule.GetBeginMonth() == 2 && day == 29) {
        // Each run is calculated from the one before, which was on March 1.
        return "It runs on March 1; on February 29 only in a leap year in which it was set before "
               "that day.";
    }
    if (schedule.GetMode() != ZEL::SCHD_MODE_MONTHLY) {
        return "";
    }
    switch (day) {
        case 29:
            return "For a February without day 29 it runs on March 1.";
        case 30:
            return "For February it runs on March 2, in a leap year on March 1.";
        case 31:
            return "For a month of 30 days it runs on the 1st of the next one; for February on "
                   "March 3, in a leap year on March 2.";
        default:
            return "";
    }
}

std::optional<CalendarDate> ParseDate(const std::string& text) {
    const std::vector<int> date = Numbers(text, '-', {4, 2, 2});
    if (date.empty() || !IsDate(date[0], date[1], date[2])) {
        return std::nullopt;
    }
    return CalendarDate{date[0], date[1], date[2]};
}

std::optional<TimeOfDay> ParseTimeOfDay(const std::string& text) {
    const std::vector<int> time = Numbers(text, ':', {2, 2});
    if (time.empty() || time[0] > 23 || time[1] > 59) {
        return std::nullopt;
    }
    return TimeOfDay{time[0], time[1]};
}

}  // namespace programs
