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

    int OpenFile(int rotate_count, int level = Logger::LEVEL_DEBUG) {
        return Logger::Initialize(Logger::LOGFILE, level, path_, rotate_count);
    }
    // Writes one line that takes `size` bytes of the file, the time included.
    static void WriteLine(size_t size, char fill) {
        const std::string text(size - kTimeSize - 1, fill);
        Logger::LogMsg(Logger::LEVEL_ERROR, "%s\n", text.c_str());
    }
    static void WriteMoreThanOneFile(char fill) { WriteLine(0x100001, fill); }
    // The first letter behind the time of each file: of the log, then of log_0, log_1, ... and '-'
    // where there is none.
    std::string FirstLetters(int count) const {
        std::string letters;
        for (int i = -1; i < count; ++i) {
            const std::string text =
                test::ReadFile(i < 0 ? path_ : path_ + "_" + std::to_string(i));
            letters += text.size() > kTimeSize ? text[kTimeSize] : '-';
        }
        return letters;
    }

    test::TempFolder folder_;
    std::string path_ = folder_.Path("log");
};

TEST_F(Log, StartsWithErrorsToTheSystemLog) {
    Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] quiet\n");
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] %d\n", 7);
    EXPECT_THAT(test::TakeSyslogTexts(), ElementsAre("[ERROR] 7\n"));
}

TEST_F(Log, TheSystemLogGetsEveryLevelAtPriorityError) {
    Logger::Initialize(Logger::SYSLOG, Logger::LEVEL_DEBUG, path_, 1);
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] x\n");
    const std::vector<test::SyslogLine> lines = test::TakeSyslog();
    ASSERT_EQ(lines.size(), 1U);
    EXPECT_EQ(lines[0].priority, 3);
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
        const std::string out = testing::internal::GetCapturedStdout();
        const std::string err = testing::internal::GetCapturedStderr();
        EXPECT_THAT(type == Logger::STDOUT ? out : err,
                    MatchesRegex(kTime + std::string("\\[NOTE\\] a%b")));
        EXPECT_THAT(type == Logger::STDOUT ? err : out, IsEmpty());
    }
}

TEST_F(Log, AnUnknownTypeIsAFileOrElseUntimedLinesToStandardError) {
    EXPECT_EQ(Logger::Initialize(static_cast<Logger::Type>(9), 3, path_, 2), 0);
    WriteLine(100, 'f');
    EXPECT_EQ(FirstLetters(0), "f");

    EXPECT_EQ(Logger::Initialize(static_cast<Logger::Type>(9), 3, "", 2), -1);
    testing::internal::CaptureStderr();
    Logger::LogMsg(Logger::LEVEL_ERROR, "bare\n");
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "bare\n");
}

TEST_F(Log, AFileThatCannotBeOpenedLeavesTheLogSilent) {
    EXPECT_EQ(Logger::Initialize(Logger::LOGFILE, 3, folder_.Path("missing/log"), 2), -1);
    EXPECT_EQ(Logger::Initialize(Logger::LOGFILE, 3, "", 2), -1);
    WriteLine(100, 'x');
    EXPECT_THAT(test::TakeSyslog(), IsEmpty());
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
            WriteMoreThanOneFile(fill);
        }
        EXPECT_EQ(FirstLetters(4), c.letters) << c.rotate_count;
        Logger::Destroy();
        for (const auto& entry : std::filesystem::directory_iterator(folder_.Path())) {
            std::filesystem::remove(entry);
        }
    }
}

TEST_F(Log, ComplaintsOfARotationGoToTheSystemLog) {
    ASSERT_EQ(OpenFile(2), 0);
    WriteMoreThanOneFile('a');
    EXPECT_THAT(test::TakeSyslogTexts(),
                ElementsAre("ZEL/log:145 failed to rename old_name '" + path_ +
                                "_0' to new_name '" + path_ + "_1'.",
                            "ZEL/log:152 failed to remove old_name '" + path_ + "_1'."));
}

TEST_F(Log, AFailedRotationSilencesTheLogUntilItIsSetUpAgain) {
    ASSERT_EQ(OpenFile(1), 0);
    std::filesystem::remove(path_);
    WriteMoreThanOneFile('a');
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
