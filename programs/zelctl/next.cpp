#include "programs/zelctl/next.h"

#include <cstdio>
#include <ctime>

#include "ZEL/sync_obj.h"
#include "programs/common/table.h"
#include "programs/common/text.h"

namespace zelctl {

namespace {

// Two or three numbers between separators, all of the text.
bool ParseDate(const std::string& text, int& year, int& month, int& day) {
    int used = 0;
    return sscanf(text.c_str(), "%4d-%2d-%2d%n", &year, &month, &day, &used) == 3 &&
           static_cast<size_t>(used) == text.size();
}

bool ParseTime(const std::string& text, int& hours, int& minutes) {
    int used = 0;
    return sscanf(text.c_str(), "%2d:%2d%n", &hours, &minutes, &used) == 2 &&
           static_cast<size_t>(used) == text.size();
}

bool ParseMoment(const std::string& text, long& moment) {
    if (text.empty()) {
        moment = time(nullptr);
        return true;
    }
    int year = 0;
    int month = 0;
    int day = 0;
    struct tm local = {};
    const size_t blank = text.find(' ');
    if (blank == std::string::npos || !ParseDate(text.substr(0, blank), year, month, day) ||
        !ParseTime(text.substr(blank + 1), local.tm_hour, local.tm_min)) {
        return false;
    }
    local.tm_year = year - 1900;
    local.tm_mon = month - 1;
    local.tm_mday = day;
    local.tm_isdst = -1;
    moment = mktime(&local);
    return moment >= 0;
}

ExitCode BadValue(const char* option, const std::string& value, const char* form) {
    return Fail(kUsage, "--%s: '%s' is not %s", option, programs::Printable(value).c_str(), form);
}

}  // namespace

ExitCode ShowNextRuns(const NextOptions& options) {
    ZEL::Schedule schedule;
    schedule.SetModeByStr(options.mode);
    if (schedule.GetModeStr() != options.mode) {
        return BadValue("mode", options.mode, "manual, realtime, weekly, monthly, yearly or once");
    }
    if (options.week.size() != 7 || options.week.find_first_not_of("01") != std::string::npos ||
        options.week == "0000000") {
        return BadValue("week", options.week, "seven digits 0 or 1, Sunday first, at least one 1");
    }
    int year = 0;
    int month = 0;
    int day = 0;
    int hours = 0;
    int minutes = 0;
    if (!ParseDate(options.begin, year, month, day)) {
        return BadValue("begin", options.begin, "a date YYYY-MM-DD");
    }
    if (!ParseTime(options.start, hours, minutes)) {
        return BadValue("start", options.start, "a time HH:MM");
    }
    schedule.SetWeekSchedule(options.week);
    schedule.SetBeginYear(year);
    schedule.SetBeginMonth(month);
    schedule.SetBeginDay(day);
    schedule.SetStartHour(hours);
    schedule.SetStartMinute(minutes);
    if (!ParseTime(options.period, hours, minutes)) {
        return BadValue("period", options.period, "a time HH:MM");
    }
    // The count first: a period of 0 then takes it back, as a period without a count would go.
    schedule.SetRepeatTimesInDay(static_cast<long>(options.repeat));
    schedule.SetPeriod(hours, minutes);
    if (!schedule.Validate()) {
        return Fail(kUsage,
                    "the schedule is not possible: check the begin date, the start time, and that "
                    "all repeats "
                    "fall on the same day");
    }
    long moment = 0;
    if (!ParseMoment(options.from, moment)) {
        return BadValue("from", options.from, "a moment 'YYYY-MM-DD HH:MM'");
    }
    programs::Table table({"NEXT RUN", "SECONDS"});
    for (unsigned int i = 0; i < options.count; ++i) {
        moment = schedule.GetNextScheduledSeconds(moment);
        if (moment < 0) {
            return Fail(kFailed, "the next run cannot be computed (see the system log)");
        }
        if (moment == 0) {
            break;  // no further run
        }
        table.Add({programs::HumanTime(moment), std::to_string(moment)});
    }
    table.Print(options.as_json);
    return kOk;
}

}  // namespace zelctl
