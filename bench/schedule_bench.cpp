// How much the next run of a schedule costs beyond the C library's calendar calls that it needs.
//
//     cmake --preset bench && cmake --build --preset bench --target schedule_bench
//     build/bench/bin/schedule_bench
//
// This program stands between the library and the C library: it notes each localtime_r() and
// mktime() with its argument, then makes the very same calls again in a tight loop. A ratio of 1.10
// says that a tenth is added to them.
#include <dlfcn.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <algorithm>
#include <chrono>
#include <vector>

#include "ZEL/sync_obj.h"

namespace {

template <typename Function>
Function Next(const char* name) {
    return reinterpret_cast<Function>(dlsym(RTLD_NEXT, name));
}

const auto real_localtime_r = Next<decltype(&localtime_r)>("localtime_r");
const auto real_mktime = Next<decltype(&mktime)>("mktime");

struct Calls {
    std::vector<time_t> localtime;
    std::vector<struct tm> mktime;
};
Calls* noted = nullptr;  // where calls are noted; null while time is taken

}  // namespace

extern "C" {

__attribute__((visibility("default"))) struct tm* localtime_r(const time_t* seconds,
                                                              struct tm* time) noexcept {
    if (noted != nullptr) {
        noted->localtime.push_back(*seconds);
    }
    return real_localtime_r(seconds, time);
}

__attribute__((visibility("default"))) time_t mktime(struct tm* time) noexcept {
    if (noted != nullptr) {
        noted->mktime.push_back(*time);
    }
    return real_mktime(time);
}
}

namespace {

constexpr int kReferences = 1000;
constexpr int kRounds = 60;

volatile long sink;  // keeps the results alive

template <typename Work>
double Nanoseconds(Work work) {
    const auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double, std::nano>(std::chrono::steady_clock::now() - start)
        .count();
}

void Compare(const char* name, const ZEL::Schedule& schedule, int from_hour) {
    // About the same hour (UTC) of most days over three and a half years.
    std::vector<long> references;
    for (long i = 0; i < kReferences; ++i) {
        references.push_back(1735689600 + i * 31 / 24 * 86400 + from_hour * 3600L + i % 1800);
    }
    const auto runs = [&] {
        for (const long reference : references) {
            sink = schedule.GetNextScheduledSeconds(reference);
        }
    };
    Calls calls;
    noted = &calls;
    runs();
    noted = nullptr;
    const auto bare = [&] {
        for (const time_t seconds : calls.localtime) {
            struct tm time;
            real_localtime_r(&seconds, &time);
            sink = time.tm_mday;
        }
        for (struct tm time : calls.mktime) {
            sink = real_mktime(&time);
        }
    };
    double run_time = Nanoseconds(runs);
    double bare_time = Nanoseconds(bare);
    for (int i = 0; i < kRounds; ++i) {
        run_time = std::min(run_time, Nanoseconds(runs));
        bare_time = std::min(bare_time, Nanoseconds(bare));
    }
    printf(
        "%-34s %6.0f ns a run, %6.0f ns its bare calls (%.1f localtime_r, %.1f mktime): ratio "
        "%.2f\n",
        name, run_time / kReferences, bare_time / kReferences,
        static_cast<double>(calls.localtime.size()) / kReferences,
        static_cast<double>(calls.mktime.size()) / kReferences, run_time / bare_time);
}

ZEL::Schedule At(ZEL::SCHD_MODE mode, int hour, long period = 0, long repeat_times = 0) {
    ZEL::Schedule schedule;
    schedule.SetMode(mode);
    schedule.SetBeginYear(2040);
    schedule.SetBeginMonth(6);
    schedule.SetBeginDay(15);
    schedule.SetWeekSchedule("0111110");
    schedule.SetStartHour(hour);
    schedule.SetPeriod(period);
    schedule.SetRepeatTimesInDay(repeat_times);
    return schedule;
}

}  // namespace

int main() {
    setenv("TZ", "Europe/Berlin", 1);
    tzset();
    printf("The next run of a schedule beside the same calls of the C library, in %s:\n",
           getenv("TZ"));
    Compare("weekly, the day's run still ahead", At(ZEL::SCHD_MODE_WEEKLY, 23), 8);
    Compare("weekly, the day's run over", At(ZEL::SCHD_MODE_WEEKLY, 3), 8);
    Compare("weekly, among 95 repeats", At(ZEL::SCHD_MODE_WEEKLY, 0, 900, 95), 8);
    Compare("monthly", At(ZEL::SCHD_MODE_MONTHLY, 3), 8);
    Compare("yearly", At(ZEL::SCHD_MODE_YEARLY, 3), 8);
    Compare("once", At(ZEL::SCHD_MODE_ONCE, 3), 8);
    return 0;
}
