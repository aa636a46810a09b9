#pragma once

#include <gtest/gtest.h>
#include <time.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "ZEL/sync_obj.h"

namespace test {

/// Sets the process's time zone.
inline void SetZone(const char* zone) {
    setenv("TZ", zone, 1);
    tzset();
}

/// "2015-03-16 08:00:00" to seconds since the epoch, and back.
inline long Utc(const char* text) {
    struct tm time = {};
    EXPECT_NE(strptime(text, "%Y-%m-%d %H:%M:%S", &time), nullptr) << text;
    return static_cast<long>(timegm(&time));
}
inline std::string UtcText(int64_t seconds) {
    const time_t moment = static_cast<time_t>(seconds);
    struct tm time = {};
    char text[64] = "";
    gmtime_r(&moment, &time);
    strftime(text, sizeof text, "%F %T", &time);
    return text;
}

/// The map of a task in which no field has its default, and no two fields of a type have the same
/// value.
inline ZEL::PObject FullTask() {
    ZEL::PObject task, shares;
    shares.asArray() = {"b", "a"};
    task = ZEL::PObject::Map{{"id", UINT64_MAX},
                             {"name", "nightly"},
                             {"share_list", shares},
                             {"user", "lena"},
                             {"pswd", "secret words"},
                             {"server_ip", "10.0.0.5"},
                             {"server_name", "cellar"},
                             {"compress", true},
                             {"ssh", true},
                             {"ssh_port", 2222},
                             {"max_bandwidth", -1},
                             {"rsync_timeout", 900},
                             {"schedule_mode", 4},
                             {"week_schd", "0100010"},
                             {"repeat_times_in_day", 3},
                             {"period_hour", 1},
                             {"period_minute", 30},
                             {"schedule_begin_year", 2016},
                             {"schedule_begin_month", 2},
                             {"schedule_begin_day", 29},
                             {"schedule_begin_hour", 8},
                             {"schedule_begin_min", 30}};
    return task;
}

/// `days`: a week of seven characters, or a begin date.
inline ZEL::Schedule Make(const char* mode, const char* days, int hour, long period = 0,
                          long repeat = 0) {
    ZEL::Schedule schedule;
    schedule.SetModeByStr(mode);
    int year = 0;
    int month = 0;
    int day = 0;
    if (sscanf(days, "%d-%d-%d", &year, &month, &day) == 3) {
        schedule.SetBeginYear(year);
        schedule.SetBeginMonth(month);
        schedule.SetBeginDay(day);
    } else {
        schedule.SetWeekSchedule(days);
    }
    schedule.SetStartHour(hour);
    schedule.SetPeriod(period);
    schedule.SetRepeatTimesInDay(repeat);
    return schedule;
}

}  // namespace test
