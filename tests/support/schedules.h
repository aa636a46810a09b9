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
    return timegm(&time);
}
inline std::string UtcText(int64_t seconds) {
    const time_t moment = static_cast<time_t>(seconds);
    struct tm time = {};
    char text[64] = "";
    gmtime_r(&moment, &time);
    strftime(text, sizeof text, "%F %T", &time);
    return text;
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
