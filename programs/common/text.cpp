#include "programs/common/text.h"

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <string_view>

#include "base/utf8.h"

namespace programs {

namespace {

// Characters that a terminal acts on or hides: control characters (including the 8-bit ones), line
// separators, marks that change the text direction, and invisible characters.
bool IsControl(uint32_t code) {
    return code < 0x20 || (code >= 0x7f && code <= 0x9f) || code == 0x061c || code == 0x200b ||
           code == 0x200e || code == 0x200f || (code >= 0x2028 && code <= 0x202e) ||
           (code >= 0x2060 && code <= 0x206f) || code == 0xfeff;
}

// Calls `take` for each character of `text`, or for a single byte where it is not valid UTF-8, with
// whether it can be shown as it is, and its code.
template <typename Take>
void EachCharacter(const std::string& text, Take take) {
    for (size_t i = 0; i < text.size();) {
        uint32_t code = 0;
        const size_t length = base::Utf8Character(text, i, &code);
        const bool stands = length > 0 && !IsControl(code);
        take(std::string_view(text).substr(i, std::max<size_t>(length, 1)), stands, code);
        i += std::max<size_t>(length, 1);
    }
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
    // Fast path for plain ASCII, which nearly all texts are.
    if (std::all_of(text.begin(), text.end(), [](char c) { return c >= 0x20 && c < 0x7f; })) {
        return true;
    }
    bool printable = true;
    EachCharacter(
        text, [&](std::string_view, bool stands, uint32_t) { printable = printable && stands; });
    return printable;
}

std::string Printable(const std::string& text) {
    if (IsPrintable(text)) {
        return text;
    }
    std::string printable;
    EachCharacter(text, [&](std::string_view piece, bool stands, uint32_t) {
        if (stands) {
            printable += piece;
            return;
        }
        for (const char c : piece) {
            char escaped[8];
            snprintf(escaped, sizeof escaped, "\\%03o",
                     static_cast<unsigned int>(static_cast<unsigned char>(c)));
            printable += escaped;
        }
    });
    return printable;
}

std::string PrintableLines(const std::string& text) {
    std::string lines;
    for (size_t begin = 0; begin <= text.size();) {
        const size_t end = std::min(text.find('\n', begin), text.size());
        lines += (begin == 0 ? "" : "\n") + Printable(text.substr(begin, end - begin));
        begin = end + 1;
    }
    return lines;
}

std::string SafeJson(const std::string& json) {
    if (IsPrintable(json)) {
        return json;
    }
    std::string safe;
    EachCharacter(json, [&](std::string_view piece, bool stands, uint32_t code) {
        if (stands || code < 0x20) {  // line ends between values; texts have theirs escaped already
            safe += piece;
            return;
        }
        char escaped[12];
        snprintf(escaped, sizeof escaped, "\\u%04x", code);
        safe += escaped;
    });
    return safe;
}

std::string Shortened(const std::string& text, size_t bytes) {
    constexpr std::string_view kMark = " [...]";
    if (text.size() <= bytes) {
        return text;
    }
    return std::string(base::Utf8Head(text, bytes - std::min(bytes, kMark.size()))).append(kMark);
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
