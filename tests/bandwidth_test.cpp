#include "programs/common/bandwidth.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

namespace programs {
namespace {

using testing::HasSubstr;

TEST(Bandwidth, WindowsAreReadToTheLetterOrRefusedWithAReason) {
    const struct {
        const char* said;
        Rate otherwise;
        const char* windows;
    } read[] = {
        {"512", 512, ""},
        {"0", 0, ""},
        {"1.5M", 1536, ""},
        {"2MB", 1953, ""},
        {"1gib", 1048576, ""},
        {"else=7", 7, ""},
        {"08:00-18:00=1M,else=0", 0, "08:00-18:00=1024"},
        {"else=3k,22:30-06:00=0,06:00-22:30=1", 3, "22:30-06:00=0,06:00-22:30=1"},
        {"00:00-24:00=5", 0, "00:00-24:00=5"},
        {"20:00-24:00=5,00:00-04:00=6", 0, "20:00-00:00=5,00:00-04:00=6"},
    };
    for (const auto& [said, otherwise, windows] : read) {
        const BandwidthWords words = ReadBandwidth(said);
        EXPECT_EQ(words.fault, "") << said;
        EXPECT_EQ(words.otherwise, otherwise) << said;
        EXPECT_EQ(words.windows, windows);
        EXPECT_EQ(FaultOfWindows(words.windows), "") << said;
    }
    const struct {
        const char* said;
        const char* fault;
    } refused[] = {
        {"", "no rate"},
        {"fast", "no rate"},
        {"-1", "no rate"},
        {"1.2.3", "no rate"},
        {"5T", "no rate"},
        {"0.1", "out of bounds"},
        {"99999G", "out of bounds"},
        {"08:00-18:00", "no rate"},
        {"08:00-18:00=1,", "no window"},
        {"8:00-18:00=1", "no window"},
        {"08:00-25:00=1", "no window"},
        {"24:00-08:00=1", "no window"},
        {"08:60-09:00=1", "no window"},
        {"08:00-08:00=1", "ends when it begins"},
        {"else=1,else=2", "two limits"},
        {"08:00-18:00=1,17:59-19:00=2", "two windows have 17:59"},
        {"22:00-06:00=1,05:00-07:00=2", "two windows have 05:00"},
    };
    for (const auto& [said, fault] : refused) {
        EXPECT_THAT(ReadBandwidth(said).fault, HasSubstr(fault)) << said;
    }
    EXPECT_THAT(FaultOfWindows("08:00-18:00=1,else=2"), HasSubstr("else"));
}

TEST(Bandwidth, TheClockOnTheWallSaysWhatHoldsAlsoWhenItIsPutForwardOrBack) {
    setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1);
    tzset();
    const Bandwidth night = Bandwidth::Of(100, "22:00-02:30=1,02:30-06:00=2");
    const int64_t spring = 1774742400;  // 2026-03-29 01:00 in Berlin: an hour before 03:00
    EXPECT_EQ(night.At(spring), 1U);
    EXPECT_EQ(night.Until(spring), spring + 3600);
    EXPECT_EQ(night.At(spring + 3600), 2U);
    EXPECT_EQ(night.Until(spring + 3600), spring + 4 * 3600);
    const int64_t autumn = 1792882800;  // 2026-10-25 01:00: 02:00 to 03:00 comes twice
    EXPECT_EQ(night.Until(autumn), autumn + 5400);
    EXPECT_EQ(night.Until(autumn + 5400), autumn + 7200);
    EXPECT_EQ(night.Until(autumn + 7200), autumn + 9000);
    EXPECT_EQ(night.At(autumn + 6 * 3600), 100U);
    EXPECT_FALSE(Bandwidth::Of(5, "00:00-24:00=5").Until(autumn).has_value());
    unsetenv("TZ");
    tzset();
}

}  // namespace
}  // namespace programs
