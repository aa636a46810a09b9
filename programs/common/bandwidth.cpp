#include "programs/common/bandwidth.h"

#include <time.h>

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <limits>

#include "base/text.h"
#include "programs/common/text.h"

namespace programs {

namespace {

constexpr int kHour = 60;
constexpr int kDay = 24 * kHour;
constexpr double kMaxRate = std::numeric_limits<int32_t>::max();
constexpr char kElse[] = "else";
constexpr double kKiB = 1024;

struct tm Local(int64_t moment) {
    const auto seconds = static_cast<time_t>(moment);
    struct tm local = {};
    localtime_r(&seconds, &local);
    return local;
}

// What a wall shows at `moment`, in minutes.
int MinuteOf(int64_t moment) {
    const struct tm local = Local(moment);
    return local.tm_hour * kHour + local.tm_min;
}

bool Holds(const BandwidthWindow& window, int minute) {
    return window.begin < window.end ? window.begin <= minute && minute < window.end
                                     : window.begin <= minute || minute < window.end;
}

// "08:30" in minutes, up to "24:00"; -1: it is no time.
int ReadTime(const std::string& text) {
    if (text.size() != 5 || text[2] != ':') {
        return -1;
    }
    const auto hour = base::ParseNumber(text.substr(0, 2), 24);
    const auto minute = base::ParseNumber(text.substr(3), kHour - 1);
    const int time =
        hour && minute ? static_cast<int>(*hour) * kHour + static_cast<int>(*minute) : -1;
    return time <= kDay ? time : -1;
}

std::string TimeWords(int minute) {
    char text[16];
    snprintf(text, sizeof text, "%02d:%02d", minute / kHour, minute % kHour);
    return text;
}

// In KiB. Nothing: it is none, and `fault` says why.
std::optional<Rate> ReadRate(const std::string& text, std::string& fault) {
    const size_t end = std::min(text.find_first_not_of("0123456789."), text.size());
    const std::string number = text.substr(0, end);
    std::string unit = base::Lower(text.substr(end));
    const bool decimal = unit.size() == 2 && unit[1] == 'b';
    if (decimal || (unit.size() == 3 && unit.substr(1) == "ib")) {
        unit.resize(1);
    }
    const size_t power = unit.empty() ? 0 : std::string("kmg").find(unit);
    const bool is_number = number.find_first_of("0123456789") != number.npos &&
                           std::count(number.begin(), number.end(), '.') <= 1 &&
                           number.size() <= 15;
    if (!is_number || unit.size() > 1 || power > 2) {
        fault = "'" + Printable(text) + "' is no rate, such as 512, 1.5M or 0 for no limit";
        return std::nullopt;
    }
    const double step = decimal ? 1000 : kKiB;
    double value = 0;
    std::from_chars(number.data(), number.data() + number.size(), value, std::chars_format::fixed);
    const double bytes = value * step * std::pow(step, static_cast<double>(power));
    const double rate = std::round(bytes / kKiB);
    if (rate > kMaxRate || (rate == 0 && bytes > 0)) {
        fault = "'" + Printable(text) + "' is out of bounds: a limit is 1 KiB to 2 TiB a second";
        return std::nullopt;
    }
    return static_cast<Rate>(rate);
}

// The windows and, at "else", the rate at all other times.
struct Parsed {
    std::vector<BandwidthWindow> windows;
    std::optional<Rate> otherwise;
    std::string fault;
};

std::string FaultOfOverlap(const std::vector<BandwidthWindow>& windows) {
    std::vector<const BandwidthWindow*> of_minute(kDay, nullptr);
    for (const BandwidthWindow& window : windows) {
        for (int minute = 0; minute < kDay; ++minute) {
            if (!Holds(window, minute)) {
                continue;
            }
            if (of_minute[static_cast<size_t>(minute)] != nullptr) {
                return "two windows have " + TimeWords(minute) + ": which limit holds then?";
            }
            of_minute[static_cast<size_t>(minute)] = &window;
        }
    }
    return "";
}

Parsed Parse(const std::string& words) {
    Parsed parsed;
    for (size_t begin = 0; begin <= words.size();) {
        const size_t end = std::min(words.find(',', begin), words.size());
        const std::string part = words.substr(begin, end - begin);
        begin = end + 1;
        const size_t equals = std::min(part.find('='), part.size());
        const std::string when = part.substr(0, equals);
        const std::string what = equals < part.size() ? part.substr(equals + 1) : "";
        const int from = ReadTime(when.substr(0, 5));
        const int to = when.size() == 11 && when[5] == '-' ? ReadTime(when.substr(6)) : -1;
        if (when != kElse && (from < 0 || to < 0 || from == kDay)) {
            parsed.fault =
                "'" + Printable(part) + "' is no window, such as 08:00-18:00=1M, and not else=RATE";
        } else if (when != kElse && from == to) {
            parsed.fault = "window " + when + " ends when it begins; 00:00-24:00 is all day";
        } else if (when == kElse && parsed.otherwise) {
            parsed.fault = "there are two limits for 'else'";
        }
        const auto rate = parsed.fault.empty() ? ReadRate(what, parsed.fault) : std::nullopt;
        if (!rate) {
            return parsed;
        }
        if (when == kElse) {
            parsed.otherwise = *rate;
        } else {
            parsed.windows.push_back({from, to % kDay, *rate});
            if (from == to % kDay) {  // all day
                parsed.windows.back().end = kDay;
            }
        }
    }
    parsed.fault = FaultOfOverlap(parsed.windows);
    return parsed;
}

}  // namespace

Bandwidth Bandwidth::Of(Rate otherwise, const std::string& windows) {
    return Bandwidth(otherwise,
                     windows.empty() ? std::vector<BandwidthWindow>() : Parse(windows).windows);
}

Rate Bandwidth::RateOf(const std::string& text) {
    std::string ignored;
    return ReadRate(text, ignored).value_or(0);
}

Rate Bandwidth::At(int64_t moment) const {
    if (windows_.empty()) {
        return otherwise_;
    }
    const int minute = MinuteOf(moment);
    const auto found = std::find_if(windows_.begin(), windows_.end(),
                                    [&](const auto& window) { return Holds(window, minute); });
    return found == windows_.end() ? otherwise_ : found->rate;
}

Rate Bandwidth::Now() const {
    return At(time(nullptr));
}

std::optional<int64_t> Bandwidth::Until(int64_t moment) const {
    if (windows_.empty()) {
        return std::nullopt;
    }
    const Rate rate = At(moment);
    const int64_t begin = moment - Local(moment).tm_sec;
    // By the minute, because what a wall shows may jump; windows come again every day.
    for (int minute = 1; minute <= 2 * kDay; ++minute) {
        const int64_t then = begin + int64_t{minute} * 60;
        if (At(then) != rate) {
            return then;
        }
    }
    return std::nullopt;
}

BandwidthWords ReadBandwidth(const std::string& words) {
    BandwidthWords read;
    if (words.find_first_of(":=,") == words.npos) {
        read.otherwise = ReadRate(words, read.fault).value_or(0);
        return read;
    }
    const Parsed parsed = Parse(words);
    read.fault = parsed.fault;
    read.otherwise = parsed.otherwise.value_or(0);
    for (const BandwidthWindow& window : parsed.windows) {
        read.windows += (read.windows.empty() ? "" : ",") + TimeWords(window.begin) + "-" +
                        TimeWords(window.end) + "=" + std::to_string(window.rate);
    }
    return read;
}

std::string FaultOfWindows(const std::string& windows) {
    if (windows.empty()) {
        return "";
    }
    const Parsed parsed = Parse(windows);
    return parsed.otherwise && parsed.fault.empty()
               ? "has a limit for 'else', which is max_bandwidth"
               : parsed.fault;
}

std::string RateWords(Rate rate) {
    return rate == 0 ? "none" : std::to_string(rate) + " KiB/s";
}

}  // namespace programs
