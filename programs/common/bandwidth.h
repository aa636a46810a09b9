// The limit of a task's rate, which may be another one at some times of the day.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace programs {

/// KiB a second; 0: no limit.
using Rate = uint32_t;

/// A time of the day, every day; over midnight where the end comes before the begin.
struct BandwidthWindow {
    int begin = 0;  ///< minutes since midnight, local time
    int end = 0;    ///< the first minute after it
    Rate rate = 0;
};

/// Limits by the clock on the wall, as the time zone has it: what holds is looked up by the minute
/// that it shows, so that neither a clock that is set nor a change to summer time disturbs it.
class Bandwidth {
public:
    explicit Bandwidth(Rate otherwise = 0, std::vector<BandwidthWindow> windows = {})
        : windows_(std::move(windows)), otherwise_(otherwise) {}

    /// From a task's settings, which have been checked.
    static Bandwidth Of(Rate otherwise, const std::string& windows);

    /// Of a rate in a setting's windows.
    static Rate RateOf(const std::string& text);

    /// `moment` in seconds since the epoch.
    Rate At(int64_t moment) const;
    Rate Now() const;
    /// When another limit than at `moment` will hold; nothing: never.
    std::optional<int64_t> Until(int64_t moment) const;
    bool Changes() const { return !windows_.empty(); }

private:
    std::vector<BandwidthWindow> windows_;
    Rate otherwise_;
};

/// What a person writes: a rate ("512", "1.5M", "0"), or windows ("08:00-18:00=1M,else=0"). Units
/// as rsync's: K (the default), M and G are 1024 times as much each, KB, MB and GB 1000 times.
struct BandwidthWords {
    Rate otherwise = 0;
    std::string windows;  ///< as settings have them: "08:00-18:00=1024", empty: none
    std::string fault;    ///< what is wrong; empty: nothing
};
BandwidthWords ReadBandwidth(const std::string& words);

/// What is wrong with windows of a setting, in KiB and without "else"; empty: nothing.
std::string FaultOfWindows(const std::string& windows);

/// "1024 KiB/s", "none"
std::string RateWords(Rate rate);

}  // namespace programs
