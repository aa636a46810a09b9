#include "programs/zelctl/base/moment.h"

#include <algorithm>
#include <ctime>

#include "base/text.h"
#include "programs/common/schedule_words.h"

namespace zelctl {

std::optional<int64_t> ParseMoment(const std::string& text) {
    constexpr size_t kClockLength = 5;  // HH:MM
    const size_t blank = std::min(text.find(' '), text.size());
    const std::string time = text.substr(std::min(blank + 1, text.size()));
    const bool has_seconds = time.size() == kClockLength + 3 && time[kClockLength] == ':';
    const auto date = programs::ParseDate(text.substr(0, blank));
    const auto clock = programs::ParseTimeOfDay(has_seconds ? time.substr(0, kClockLength) : time);
    const auto seconds = has_seconds ? base::ParseNumber(time.substr(kClockLength + 1), 59)
                                     : std::optional<uint64_t>(0);
    if (!date || !clock || !seconds) {
        return std::nullopt;
    }
    struct tm local = {};
    local.tm_year = date->year - 1900;
    local.tm_mon = date->month - 1;
    local.tm_mday = date->day;
    local.tm_hour = clock->hours;
    local.tm_min = clock->minutes;
    local.tm_sec = static_cast<int>(*seconds);
    local.tm_isdst = -1;
    const time_t moment = mktime(&local);
    return moment >= 0 ? std::optional<int64_t>(moment) : std::nullopt;
}

}  // namespace zelctl
