// When a task runs: Schedule of sync_obj.h.
#include <limits.h>

#include <algorithm>
#include <iterator>

#include "ZEL/log.h"
#include "ZEL/sync_obj.h"

namespace ZEL {

namespace {

constexpr size_t kDaysInWeek = 7;
constexpr char kEveryDay[] = "1111111";
constexpr char kNoDay[] = "0000000";
constexpr int kLastSecondOfDay = 86399;
constexpr int kMaxRepeatTimes = 95;  // a run each quarter of an hour

// The search's limit: a valid schedule finds a run within a few candidate days; an invalid one (a
// negative repeat count, an hour years before the day) might never find any.
constexpr int kMaxCandidateDays = 400;

// By mode.
constexpr const char* kModeTexts[] = {"manual", "realtime", "weekly", "monthly", "yearly", "once"};

// A value that does not fit a field of struct tm becomes the limit of the field's type, which
// mktime() refuses.
int ClampToInt(int64_t value) {
    return static_cast<int>(std::clamp<int64_t>(value, INT_MIN, INT_MAX));
}

// Like mktime(). Times are returned as long: a result that does not fit is a failure, even where
// time_t is wider.
long MakeTime(struct tm& time) {
    long seconds = 0;
    return __builtin_add_overflow(mktime(&time), 0, &seconds) ? -1 : seconds;
}

// `what`: which time could not be computed, for the log.
void LogTime(const char* what, const struct tm& time) {
    Logger::LogMsg(
        Logger::LEVEL_ERROR,
        "[ERROR] ZEL/sync_obj(%d): Fail to get %s seconds, year:[%d], mon:[%d], mday:[%d], "
        "hour:[%d], min:[%d], sec:[%d], dst:[%d]\n",
        __LINE__, what, time.tm_year, time.tm_mon, time.tm_mday, time.tm_hour, time.tm_min,
        time.tm_sec, time.tm_isdst);
}

bool IsSameDate(const struct tm& a, const struct tm& b) {
    return a.tm_mday == b.tm_mday && a.tm_mon == b.tm_mon && a.tm_year == b.tm_year;
}

// Moves `day` to the candidate day for its date and keeps the time of day. False when there is
// none.
bool AlignToScheduledDay(SCHD_MODE mode, const std::string& week, const struct tm& begin,
                         struct tm& day) {
    switch (mode) {
        case SCHD_MODE_WEEKLY: {
            const int days = GetDaysToNextSync(static_cast<unsigned int>(day.tm_wday), week);
            if (days < 0) {
                Logger::LogMsg(Logger::LEVEL_ERROR,
                               "[ERROR] ZEL/sync_obj(%d): No chosen week day for sync '%s'\n",
                               __LINE__, week.c_str());
                return false;
            }
            day.tm_mday += days;
            return true;
        }
        case SCHD_MODE_ONCE:
            day.tm_year = begin.tm_year;
            [[fallthrough]];
        case SCHD_MODE_YEARLY:
            day.tm_mon = begin.tm_mon;
            [[fallthrough]];
        case SCHD_MODE_MONTHLY:
            day.tm_mday = begin.tm_mday;
            return true;
        default:
            Logger::LogMsg(Logger::LEVEL_ERROR,
                           "[ERROR] ZEL/sync_obj(%d): Unknown schedule mode [%d]\n", __LINE__,
                           static_cast<int>(mode));
            return false;
    }
}

// The first of a day's runs that comes after `reference`; 0 when all are over. `first` is the day's
// first run, and neither time is negative.
long NextRunOfDay(long reference, long first, long period, long repeat_times) {
    if (repeat_times < 0) {
        return 0;
    }
    if (reference < first) {
        return first;
    }
    const long gone = reference - first;
    long run = 0;
    if (period <= 0 || gone / period >= repeat_times ||
        __builtin_add_overflow(reference, period - gone % period, &run)) {
        return 0;
    }
    return run;
}

}  // namespace

std::string Schedule::GetModeStr() const {
    return kModeTexts[mode_ < std::size(kModeTexts) ? mode_ : SCHD_MODE_WEEKLY];
}

void Schedule::SetModeByStr(const std::string& mode) {
    const auto* text = std::find(std::begin(kModeTexts), std::end(kModeTexts), mode);
    mode_ = text == std::end(kModeTexts) ? SCHD_MODE_MANUAL
                                         : static_cast<SCHD_MODE>(text - std::begin(kModeTexts));
}

void Schedule::SetPeriod(long seconds) {
    period_ = seconds;
    if (seconds == 0) {
        repeat_times_in_day_ = 0;
    }
}

void Schedule::SetPeriod(long hours, long minutes) {
    long hour_seconds = 0;
    long minute_seconds = 0;
    long seconds = 0;
    const bool too_long = __builtin_mul_overflow(hours, 3600L, &hour_seconds) ||
                          __builtin_mul_overflow(minutes, 60L, &minute_seconds) ||
                          __builtin_add_overflow(hour_seconds, minute_seconds, &seconds);
    SetPeriod(too_long ? LONG_MAX : seconds);
}

void Schedule::SetRepeatTimesInDay(long times) {
    repeat_times_in_day_ = times;
    if (times == 0) {
        period_ = 0;
    }
}

void Schedule::SetWeekSchedule(const std::string& week) {
    week_schedule_ = kEveryDay;
    if (week.size() < kDaysInWeek) {
        return;
    }
    std::transform(week.begin(), week.begin() + kDaysInWeek, week_schedule_.begin(),
                   [](char day) { return day == '0' ? '0' : '1'; });
    if (week_schedule_ == kNoDay) {
        week_schedule_ = kEveryDay;
    }
}

struct tm Schedule::GetScheduleBegin() const {
    struct tm begin = {};
    begin.tm_year = ClampToInt(int64_t{begin_year_} - 1900);
    begin.tm_mon = ClampToInt(int64_t{begin_month_} - 1);
    begin.tm_mday = begin_day_;
    begin.tm_hour = start_hour_;
    begin.tm_min = start_minute_;
    return begin;
}

bool Schedule::Validate() const {
    if (start_hour_ < 0 || start_hour_ > 23) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid begin hour\n",
                       __LINE__);
        return false;
    }
    if (start_minute_ < 0 || start_minute_ > 59) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid begin minute\n",
                       __LINE__);
        return false;
    }
    if (period_ < 0 || period_ > kLastSecondOfDay) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid period or repeat\n",
                       __LINE__);
        return false;
    }
    if (repeat_times_in_day_ < 0 || repeat_times_in_day_ > kMaxRepeatTimes) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid period\n", __LINE__);
        return false;
    }
    const int start = start_hour_ * 3600 + start_minute_ * 60;
    if (start + period_ * repeat_times_in_day_ > kLastSecondOfDay) {
        Logger::LogMsg(Logger::LEVEL_NOTE,
                       "[NOTE] ZEL/sync_obj(%d): Invalid repeat in day [%d + %lld * %lld]\n",
                       __LINE__, start, static_cast<long long>(period_),
                       static_cast<long long>(repeat_times_in_day_));
        return false;
    }
    const struct tm begin = GetScheduleBegin();
    struct tm noon = begin;
    noon.tm_hour = 12;  // no change of daylight saving moves noon to another date
    if (MakeTime(noon) < 0) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid begin\n", __LINE__);
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): %d %d %d %d %d %d\n", __LINE__,
                       noon.tm_year, noon.tm_mon, noon.tm_mday, noon.tm_hour, noon.tm_min,
                       noon.tm_sec);
        return false;
    }
    if (!IsSameDate(noon, begin)) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid begin date\n",
                       __LINE__);
        return false;
    }
    // The setter never stores such a week, but a moved-from schedule has an empty one.
    if (week_schedule_.size() != kDaysInWeek) {
        Logger::LogMsg(Logger::LEVEL_NOTE,
                       "[NOTE] ZEL/sync_obj(%d): Wrong length of weekday '%s'\n", __LINE__,
                       week_schedule_.c_str());
        return false;
    }
    if (week_schedule_ == kNoDay) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid weekday '%s'\n",
                       __LINE__, week_schedule_.c_str());
        return false;
    }
    if (mode_ > SCHD_MODE_ONCE) {
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] ZEL/sync_obj(%d): Invalid schedule mode [%d]\n",
                       __LINE__, static_cast<int>(mode_));
        return false;
    }
    return true;
}

long Schedule::GetNextScheduledSeconds(long reference) const {
    if (reference < 0) {
        return -1;
    }
    if (mode_ == SCHD_MODE_MANUAL) {
        return 0;
    }
    if (mode_ == SCHD_MODE_REALTIME) {
        return reference < LONG_MAX ? reference + 1 : -1;
    }
    const struct tm begin = GetScheduleBegin();
    // Where the search for a day starts: the reference, then the midnight after each day that has
    // no run left. mktime() costs more than all the rest here, so it is not called for what is
    // already known: `now` comes normalised from localtime_r(), and a candidate day on the date of
    // `now` is `now`, to the second.
    struct tm now = {};
    long now_seconds = reference;
    const time_t moment = reference;
    if (localtime_r(&moment, &now) == nullptr) {
        return -1;
    }
    for (int candidates = 0; candidates < kMaxCandidateDays; ++candidates) {
        struct tm day = now;
        if (!AlignToScheduledDay(mode_, week_schedule_, begin, day)) {
            Logger::LogMsg(Logger::LEVEL_ERROR,
                           "[ERROR] ZEL/sync_obj(%d): Fail to align to scheduled day\n", __LINE__);
            return -1;
        }
        if (now_seconds < 0) {
            LogTime("reference", now);
            return -1;
        }
        if (!IsSameDate(day, now)) {
            const long day_seconds = MakeTime(day);
            if (day_seconds < 0) {
                LogTime("scheduled", day);
                return -1;
            }
            if (day_seconds < now_seconds) {
                switch (mode_) {
                    case SCHD_MODE_MONTHLY:
                        day.tm_mon += 1;
                        break;
                    case SCHD_MODE_YEARLY:
                        day.tm_year = ClampToInt(int64_t{day.tm_year} + 1);
                        break;
                    case SCHD_MODE_ONCE:
                        return 0;
                    case SCHD_MODE_WEEKLY:
                        Logger::LogMsg(Logger::LEVEL_ERROR,
                                       "[ERROR] ZEL/sync_obj(%d): No chosen week day for sync\n",
                                       __LINE__);
                        return -1;
                    default:
                        Logger::LogMsg(Logger::LEVEL_ERROR,
                                       "[ERROR] ZEL/sync_obj(%d): Unsupported schedule mode [%d]\n",
                                       __LINE__, static_cast<int>(mode_));
                        return -1;
                }
            }
        }
        // The day keeps the daylight-saving flag of the date that it was computed from: a start on
        // the other side of a change is shifted by it.
        struct tm first = day;
        first.tm_hour = start_hour_;
        first.tm_min = start_minute_;
        first.tm_sec = 0;
        const long first_seconds = MakeTime(first);
        if (first_seconds < 0) {
            LogTime("scheduled", first);
        } else if (const long run =
                       NextRunOfDay(reference, first_seconds, period_, repeat_times_in_day_);
                   run != 0) {
            return run;
        }
        now = day;
        now.tm_hour = 0;
        now.tm_min = 0;
        now.tm_sec = 0;
        now.tm_mday += 1;
        now_seconds = MakeTime(now);
        if (now_seconds < 0) {
            Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/sync_obj(%d): Fail to mktime.\n",
                           __LINE__);
        }
    }
    return -1;
}

int GetDaysToNextSync(unsigned int weekday, const std::string& week) {
    for (size_t days = 0; days < kDaysInWeek; ++days) {
        const size_t day = (weekday % kDaysInWeek + days) % kDaysInWeek;
        if (day < week.size() && week[day] == '1') {
            return static_cast<int>(days);
        }
    }
    return -1;
}

}  // namespace ZEL
