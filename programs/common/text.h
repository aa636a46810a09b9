#pragma once

#include <cstdint>
#include <string>

namespace programs {

/// "0 B", "1.5 KiB", "23 MiB" ...
std::string HumanBytes(uint64_t bytes);

/// "1:05" or "2:01:05", from seconds.
std::string HumanDuration(uint64_t seconds);

/// "45 ms" or "1.2 s", from seconds.
std::string HumanElapsed(double seconds);

/// "1 file", "2 files": `noun` with an "s" where there is not just one.
std::string Count(uint64_t count, const std::string& noun);

/// A local date and time, "2026-11-21 08:30:00".
std::string HumanTime(int64_t seconds_since_epoch);

/// The same in few columns: "08:30" on the day of `now`, "11-21 08:30" within half a year of it,
/// and "2027-11-21" otherwise.
std::string BriefTime(int64_t seconds_since_epoch, int64_t now);

/// `text` with control characters, the eight-bit ones included, written as \ooo: safe on a
/// terminal.
std::string Printable(const std::string& text);
/// Whether Printable() would give the text as it is.
bool IsPrintable(const std::string& text);

/// A text of several lines as one.
std::string OneLine(const std::string& text);

/// Whether a task may be called so: 1 to 128 bytes without control characters, quotes and brackets,
/// which the server's registry has no place for.
bool IsTaskName(const std::string& name);

}  // namespace programs
