#include "ZEL/log.h"

#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <thread>

#include "tests/support/syslog_capture.h"
#include "tests/support/temp_root.h"

namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::MatchesRegex;
using ZEL::Logger;

constexpr size_t kTimeSize = sizeof "Nov 21 11:35:07 " - 1;
constexpr char kTime[] = "[A-Z][a-z][a-z] [0-9][0-9] [0-9][0-9]:[0-9][0-9]:[0-9][0-9] ";

class Log : public testing::Test {
protected:
    Log() { test::TakeSyslog(); }
    ~Log() override {
        Logger::Destroy();
        Logger::Initialize(Logger::SYSLOG, Logger::LEVEL_ERROR, "", 0);
    }

    int OpenFile(int rotate_count) const {
        return Logger::Initialize(Logger::LOGFILE, 3, path_, rotate_count);
    }
    // Writes one line that takes `size` bytes of the file, the time included.
    static void WriteLine(size_t size, char fill) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "%s\n",
                       std::string(size - kTimeSize - 1, fill).c_str());
    }
    // The first letter behind the time of the log, log_0, log_1, ...; '-' where there is none.
    std::string FirstLetters(int count) const {
        std::string letters;
        for (int i = -1; i < count; ++i) {
            const std::string text =
                test::ReadFile(i < 0 ? path_ : path_ + "_" + std::to_string(i));
            letters += text.size() > kTimeSize ? text[kTimeSize] : '-';
        }
        return letters;
    }

    const test::TempFolder folder_;
    const std::string path_ = folder_.Path("log");
};

TEST_F(Log, SystemLogGetsAllThatPassesTheLevelAtPriorityErrorAndAtFirstErrorsAlone) {
    Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] quiet\n");
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] %d\n", 7);
    Logger::Initialize(Logger::SYSLOG, Logger::LEVEL_DEBUG, path_, 1);
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] x\n");
    const std::vector<test::SyslogLine> lines = test::TakeSyslog();
    ASSERT_EQ(lines.size(), 2U);
    EXPECT_EQ(lines[0].text, "[ERROR] 7\n");
    EXPECT_EQ(lines[1].text, "[DEBUG] x\n");
    EXPECT_EQ(lines[1].priority, 3);
    EXPECT_FALSE(std::filesystem::exists(path_));
}

TEST_F(Log, StandardStreamsGetTheTimeInFront) {
    for (const Logger::Type type : {Logger::STDOUT, Logger::STDERR}) {
        testing::internal::CaptureStdout();
        testing::internal::CaptureStderr();
        EXPECT_EQ(Logger::Initialize(type, Logger::LEVEL_NOTE, "", 0), 0);
        errno = 4711;
        Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] a%%%s", "b");
        Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] filtered");
        EXPECT_EQ(errno, 4711);
        std::string written = testing::internal::GetCapturedStdout();
        std::string other = testing::internal::GetCapturedStderr();
        if (type == Logger::STDERR) {
            std::swap(written, other);
        }
        EXPECT_THAT(written, MatchesRegex(kTime + std::string("\\[NOTE\\] a%b")));
        EXPECT_THAT(other, IsEmpty());
    }
}

TEST_F(Log, WithoutItsFileIsSilentAndOfAnUnknownTypeUntimed) {
    EXPECT_EQ(Logger::Initialize(Logger::LOGFILE, 3, folder_.Path("missing/log"), 2), -1);
    EXPECT_EQ(Logger::Initialize(Logger::LOGFILE, 3, "", 2), -1);
    testing::internal::CaptureStdout();
    WriteLine(100, 'x');
    EXPECT_EQ(Logger::Initialize(static_cast<Logger::Type>(9), 3, path_, 2), 0);
    WriteLine(100, 'f');
    EXPECT_EQ(FirstLetters(0), "f");
    EXPECT_EQ(Logger::Initialize(static_cast<Logger::Type>(9), 3, "", 2), -1);
    testing::internal::CaptureStderr();
    Logger::LogMsg(Logger::LEVEL_ERROR, "bare\n");
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "bare\n");
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
}

TEST_F(Log, RotatesAboveOneMebibyteOfItsOwnLines) {
    folder_.Write("log", std::string(0x100000, 'o') + "\n");
    ASSERT_EQ(OpenFile(2), 0);
    WriteLine(0x100000 - 100, 'a');
    WriteLine(100, 'b');
    EXPECT_FALSE(std::filesystem::exists(path_ + "_0"));
    WriteLine(100, 'c');
    EXPECT_EQ(test::ReadFile(path_), "");
    EXPECT_EQ(test::ReadFile(path_ + "_0").size(), 2 * 0x100000U + 101);
    WriteLine(0x100000, 'd');
    EXPECT_EQ(FirstLetters(0), "d") << "the count starts again after a rotation";
}

TEST_F(Log, KeepsOneRotatedFileFewerThanTheCount) {
    struct {
        int rotate_count;
        const char* letters;  // after the rotations of a, b, c and d
    } const cases[] = {{4, "-dcb-"}, {2, "-d---"}, {1, "-d---"}, {0, "-d---"}};
    for (const auto& c : cases) {
        ASSERT_EQ(OpenFile(c.rotate_count), 0);
        for (const char fill : {'a', 'b', 'c', 'd'}) {
            WriteLine(0x100001, fill);
        }
        EXPECT_EQ(FirstLetters(4), c.letters) << c.rotate_count;
        Logger::Destroy();
        for (const auto& entry : std::filesystem::directory_iterator(folder_.Path())) {
            std::filesystem::remove(entry);
        }
    }
}

TEST_F(Log, AFailedRotationIsReportedAndSilencesTheLogUntilItIsSetUpAgain) {
    ASSERT_EQ(OpenFile(2), 0);
    std::filesystem::remove(path_);
    WriteLine(0x100001, 'a');
    EXPECT_THAT(test::TakeSyslogTexts(),
                ElementsAre("ZEL/log:145 failed to rename old_name '" + path_ +
                                "_0' to new_name '" + path_ + "_1'.",
                            "ZEL/log:152 failed to remove old_name '" + path_ + "_1'."));
    WriteLine(100, 'b');
    EXPECT_FALSE(std::filesystem::exists(path_));
    ASSERT_EQ(OpenFile(1), 0);
    WriteLine(100, 'c');
    EXPECT_EQ(FirstLetters(0), "c");
}

TEST_F(Log, AfterDestroyOfAFileErrorsGoToStandardOutput) {
    ASSERT_EQ(OpenFile(1), 0);
    Logger::Destroy();
    Logger::Destroy();
    testing::internal::CaptureStdout();
    Logger::LogMsg(Logger::LEVEL_WARNING, "filtered\n");
    Logger::LogMsg(Logger::LEVEL_ERROR, "out\n");
    EXPECT_THAT(testing::internal::GetCapturedStdout(), MatchesRegex(kTime + std::string("out\n")));
    EXPECT_EQ(test::ReadFile(path_), "");
}

TEST_F(Log, LinesOfSeveralThreadsStayWholeAcrossRotations) {
    constexpr size_t kLineSize = 4096;
    constexpr size_t kLinesEach = 150;
    ASSERT_EQ(OpenFile(50), 0);
    std::vector<std::thread> threads;
    for (const char fill : {'a', 'b', 'c', 'd'}) {
        threads.emplace_back([fill] {
            for (size_t i = 0; i < kLinesEach; ++i) {
                WriteLine(kLineSize, fill);
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    size_t lines = 0;
    for (const auto& entry : std::filesystem::directory_iterator(folder_.Path())) {
        const std::string text = test::ReadFile(entry.path());
        ASSERT_EQ(text.size() % kLineSize, 0U);
        for (size_t at = 0; at < text.size(); at += kLineSize, ++lines) {
            const size_t first = at + kTimeSize;
            ASSERT_EQ(text.find_first_not_of(text[first], first), at + kLineSize - 1);
        }
    }
    EXPECT_EQ(lines, 4 * kLinesEach);
}

}  // namespace
