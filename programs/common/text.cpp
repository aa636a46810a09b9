#include "programs/common/text.h"

#include <algorithm>
#include <cstdio>
#include <ctime>

namespace programs {

namespace {

// Whether byte `i` is a control character, or the first byte of one of U+0080 to U+009F, which
// some terminals obey as well.
bool IsControl(const std::string& text, size_t i) {
    const unsigned char byte = static_cast<unsigned char>(text[i]);
    if (byte == 0xc2 && i + 1 < text.size()) {
        return (static_cast<unsigned char>(text[i + 1]) & 0xe0) == 0x80;
    }
    return byte < 0x20 || byte == 0x7f;
}

}  // namespace

std::string HumanBytes(uint64_t bytes) {
    static const char* const units[] = {"B", "KiB", "MiB", "GiB", "TiB", "PiB", "EiB"};
    size_t unit = 0;
    double value = static_cast<double>(bytes);
    while (value >= 1024 && unit + 1 < std::size(units)) {
        value /= 1024;
        ++unit;
    }
    char text[32];
    snprintf(text, sizeof text, unit == 0 || value >= 100 ? "%.0f %s" : "%.1f %s", value,
             units[unit]);
    return text;
}

std::string HumanDuration(uint64_t seconds) {
    char text[40];
    const unsigned long long hours = seconds / 3600;
    const unsigned int minutes = static_cast<unsigned int>(seconds / 60 % 60);
    const unsigned int rest = static_cast<unsigned int>(seconds % 60);
    if (hours > 0) {
        snprintf(text, sizeof text, "%llu:%02u:%02u", hours, minutes, rest);
    } else {
        snprintf(text, sizeof text, "%u:%02u", minutes, rest);
    }
    return text;
}

std::string HumanElapsed(double seconds) {
    char text[32];
    if (seconds < 1) {
        snprintf(text, sizeof text, "%.0f ms", seconds * 1000);
    } else {
        snprintf(text, sizeof text, "%.1f s", seconds);
    }
    return text;
}

std::string Count(uint64_t count, const std::string& noun) {
    return std::to_string(count) + " " + noun + (count == 1 ? "" : "s");
}

std::string HumanTime(int64_t seconds_since_epoch) {
    const time_t moment = static_cast<time_t>(seconds_since_epoch);
    struct tm local = {};
    char text[64] = "";
    if (localtime_r(&moment, &local) != nullptr) {
        strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &local);
    }
    return text;
}

std::string BriefTime(int64_t seconds_since_epoch, int64_t now) {
    constexpr int64_t kHalfYear = int64_t{182} * 86400;
    std::string whole = HumanTime(seconds_since_epoch);
    const size_t day = whole.find(' ');
    if (day == std::string::npos || day < 6) {
        return whole;
    }
    if (HumanTime(now).compare(0, day, whole, 0, day) == 0) {
        return whole.substr(day + 1, 5);
    }
    return seconds_since_epoch > now - kHalfYear && seconds_since_epoch < now + kHalfYear
               ? whole.substr(day - 5, 11)
               : whole.substr(0, day);
}

bool IsPrintable(const std::string& text) {
    for (size_t i = 0; i < text.size(); ++i) {
        if (IsControl(text, i)) {
            return false;
        }
    }
    return true;
}

std::string Printable(const std::string& text) {
    if (IsPrintable(text)) {
        return text;
    }
    std::string printable;
    for (size_t i = 0; i < text.size(); ++i) {
        if (IsControl(text, i)) {
            char escaped[8];
            snprintf(escaped, sizeof escaped, "\\%03o",
                     static_cast<unsigned int>(static_cast<unsigned char>(text[i])));
            printable += escaped;
        } else {
            printable += text[i];
        }
    }
    return printable;
}

std::string OneLine(const std::string& text) {
    std::string line;
    for (const char c : text) {
        if (c == '\n') {
            line += "; ";
        } else {
            line += c;
        }
    }
    return line;
}

bool IsTaskName(const std::string& name) {
    constexpr size_t kMaxBytes = 128;
    return !name.empty() && name.size() <= kMaxBytes &&
           std::none_of(name.begin(), name.end(), [](char c) {
               const auto byte = static_cast<unsigned char>(c);
               return byte < 0x20 || byte == 0x7f || c == '"' || c == '[' || c == ']';
           });
}

}  // namespace programs
