#include "programs/zelctl/task/next.h"

#include <algorithm>
#include <ctime>

#include "programs/common/failure.h"
#include "programs/common/schedule_words.h"
#include "programs/common/table.h"
#include "programs/common/text.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::ParseDate;
using programs::ParseTimeOfDay;

bool ParseMoment(const std::string& text, long& moment) {
    if (text.empty()) {
        moment = time(nullptr);
        return true;
    }
    const size_t blank = std::min(text.find(' '), text.size());
    const auto date = ParseDate(text.substr(0, blank));
    const auto clock = ParseTimeOfDay(text.substr(std::min(blank + 1, text.size())));
    if (!date || !clock) {
        return false;
    }
    struct tm local = {};
    local.tm_year = date->year - 1900;
    local.tm_mon = date->month - 1;
    local.tm_mday = date->day;
    local.tm_hour = clock->hours;
    local.tm_min = clock->minutes;
    local.tm_isdst = -1;
    moment = mktime(&local);
    return moment >= 0;
}

Failure BadValue(const std::string& option, const std::string& value, const char* form) {
    return {FailureKind::kUsage,
            "--" + option + ": '" + programs::Printable(value) + "' is not " + form};
}

}  // namespace

void ShowNextRuns(const NextOptions& options) {
    ZEL::Schedule schedule;
    schedule.SetModeByStr(options.mode);
    if (schedule.GetModeStr() != options.mode) {
        throw BadValue("mode", options.mode, "manual, realtime, weekly, monthly, yearly or once");
    }
    if (options.week.size() != 7 || options.week.find_first_not_of("01") != std::string::npos ||
        options.week == "0000000") {
        throw BadValue("week", options.week, "seven digits 0 or 1, Sunday first, at least one 1");
    }
    const auto begin = ParseDate(options.begin);
    if (!begin) {
        throw BadValue("begin", options.begin, "a date YYYY-MM-DD");
    }
    const auto start = ParseTimeOfDay(options.start);
    if (!start) {
        throw BadValue("start", options.start, "a time HH:MM");
    }
    const auto period = ParseTimeOfDay(options.period);
    if (!period) {
        throw BadValue("period", options.period, "a time HH:MM");
    }
    schedule.SetWeekSchedule(options.week);
    schedule.SetBeginYear(begin->year);
    schedule.SetBeginMonth(begin->month);
    schedule.SetBeginDay(begin->day);
    schedule.SetStartHour(start->hours);
    schedule.SetStartMinute(start->minutes);
    // The count first: a period of 0 then takes it back, as a period without a count would go.
    schedule.SetRepeatTimesInDay(static_cast<long>(options.repeat));
    schedule.SetPeriod(period->hours, period->minutes);
    if (!schedule.Validate()) {
        throw Failure(FailureKind::kUsage,
                      "the schedule is not possible: all repeats must fall on the same day");
    }
    long moment = 0;
    if (!ParseMoment(options.from, moment)) {
        throw BadValue("from", options.from, "a moment 'YYYY-MM-DD HH:MM'");
    }
    ShowNextRuns(schedule, moment, options.count, options.as_json);
}

void ShowNextRuns(const ZEL::Schedule& schedule, long after, unsigned int count, bool as_json) {
    programs::Table table(as_json ? std::vector<programs::Column>{"NEXT RUN", "SECONDS"}
                                  : std::vector<programs::Column>{"NEXT RUN"});
    long moment = after;
    for (unsigned int i = 0; i < count; ++i) {
        moment = schedule.GetNextScheduledSeconds(moment);
        if (moment < 0) {
            throw Failure("the next run cannot be computed (see the system log)");
        }
        if (moment == 0) {
            break;  // no further run
        }
        std::vector<std::string> row = {programs::HumanTime(moment)};
        if (as_json) {
            row.push_back(std::to_string(moment));
        }
        table.Add(std::move(row));
    }
    table.Print(as_json);
}

}  // namespace zelctl
