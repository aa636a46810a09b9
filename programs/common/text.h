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

/// "1 file", "2 files": `noun`, with an "s" unless `count` is 1.
std::string Count(uint64_t count, const std::string& noun);

/// A local date and time, "2026-11-21 08:30:00".
std::string HumanTime(int64_t seconds_since_epoch);

/// The same in a short form: "08:30" on the day of `now`, "11-21 08:30" within half a year of it,
/// and "2027-11-21" otherwise.
std::string BriefTime(int64_t seconds_since_epoch, int64_t now);

/// `text` with everything that a terminal would act on written as \ooo, byte by byte: control
/// characters (including the 8-bit ones), marks that change the text direction, invisible
/// characters, and bytes that are not valid UTF-8.
std::string Printable(const std::string& text);
/// Whether Printable() would return the text unchanged.
bool IsPrintable(const std::string& text);

/// The same, line by line.
std::string PrintableLines(const std::string& text);
/// JSON in UTF-8 with the same characters written as \uxxxx; line ends between values are kept.
std::string SafeJson(const std::string& json);

/// `text` cut to at most that many bytes, with a mark at the end if it was cut.
std::string Shortened(const std::string& text, size_t bytes);

/// Joins the lines of a text into one.
std::string OneLine(const std::string& text);

/// Whether a task may have this name: 1 to 128 bytes without control characters, quotes and
/// brackets, which the server's registry cannot store.
bool IsTaskName(const std::string& name);

}  // namespace programs
