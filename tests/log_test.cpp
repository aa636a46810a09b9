#include "ZEL/log.h"

#include "tests/support/syslog_capture.h"
#include "tests/support/testing.h"

namespace {

using namespace testing;
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
    std::string FirstLetters() const {
        std::string letters;
        for (const char* suffix : {"", "_0", "_1", "_2", "_3"}) {
            const std::string text = test::ReadFile(path_ + suffix);
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
    EXPECT_EQ(lines[0].text + lines[1].text, "[ERROR] 7\n[DEBUG] x\n");
    EXPECT_EQ(lines[1].priority, 3);
    EXPECT_FALSE(fs::exists(path_));
}

TEST_F(Log, StandardStreamsGetTheTimeInFrontAsStandardOutputDoesAfterAFile) {
    for (const Logger::Type type : {Logger::STDERR, Logger::STDOUT, Logger::LOGFILE}) {
        testing::internal::CaptureStdout();
        testing::internal::CaptureStderr();
        EXPECT_EQ(Logger::Initialize(type, Logger::LEVEL_ERROR, path_, 1), 0);
        if (type == Logger::LOGFILE) {
            Logger::Destroy();
            Logger::Destroy();
        }
        errno = 4711;
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] a%%%s", "b");
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] filtered");
        EXPECT_EQ(errno, 4711);
        std::string written = testing::internal::GetCapturedStdout();
        std::string other = testing::internal::GetCapturedStderr();
        if (type == Logger::STDERR) {
            std::swap(written, other);
        }
        EXPECT_THAT(written, MatchesRegex(kTime + std::string("\\[ERROR\\] a%b")));
        EXPECT_EQ(other + test::ReadFile(path_), "");
    }
}

TEST_F(Log, WithoutItsFileIsSilentAndOfAnUnknownTypeUntimed) {
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    EXPECT_EQ(Logger::Initialize(Logger::LOGFILE, 3, "", 2), -1);
    EXPECT_EQ(Logger::Initialize(Logger::LOGFILE, 3, folder_.Path("missing/log"), 2), -1);
    WriteLine(100, 'x');
    const auto unknown = static_cast<Logger::Type>(9);
    EXPECT_EQ(Logger::Initialize(unknown, 3, path_, 2), 0);
    WriteLine(100, 'f');
    EXPECT_EQ(FirstLetters(), "f----");
    EXPECT_EQ(Logger::Initialize(unknown, 3, "", 2), -1);
    Logger::LogMsg(Logger::LEVEL_ERROR, "bare\n");
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "bare\n");
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
}

TEST_F(Log, RotatesAboveOneMebibyteOfItsOwnLines) {
    folder_.Write("log", std::string(0x100000, 'o') + "\n");
    ASSERT_EQ(OpenFile(2), 0);
    WriteLine(0x100000 - 100, 'a');
    WriteLine(100, 'b');
    EXPECT_FALSE(fs::exists(path_ + "_0"));
    WriteLine(100, 'c');
    EXPECT_EQ(test::ReadFile(path_), "");
    EXPECT_EQ(test::ReadFile(path_ + "_0").size(), 2 * 0x100000U + 101);
    WriteLine(0x100000, 'd');
    EXPECT_EQ(FirstLetters()[0], 'd') << "the count starts again after a rotation";
}

TEST_F(Log, KeepsOneRotatedFileFewerThanTheCount) {
    // What remains of the rotations of a, b, c and d.
    for (const auto& [rotate_count, letters] :
         {std::pair(0, "-d---"), {1, "-d---"}, {2, "-d---"}, {4, "-dcb-"}}) {
        fs::remove(path_ + "_0");
        ASSERT_EQ(OpenFile(rotate_count), 0);
        for (const char fill : {'a', 'b', 'c', 'd'}) {
            WriteLine(0x100001, fill);
        }
        EXPECT_EQ(FirstLetters(), letters) << rotate_count;
        for (const auto& file : fs::directory_iterator(folder_.Path())) {
            EXPECT_EQ(fs::status(file).permissions() & fs::perms(0037), fs::perms(0)) << file;
        }
    }
}

TEST_F(Log, AFailedRotationIsReportedAndSilencesTheLogUntilItIsSetUpAgain) {
    ASSERT_EQ(OpenFile(2), 0);
    fs::remove(path_);
    WriteLine(0x100001, 'a');
    EXPECT_THAT(test::TakeSyslogTexts(),
                ElementsAre("ZEL/log:145 failed to rename old_name '" + path_ +
                                "_0' to new_name '" + path_ + "_1'.",
                            "ZEL/log:152 failed to remove old_name '" + path_ + "_1'."));
    WriteLine(100, 'b');
    EXPECT_FALSE(fs::exists(path_));
    ASSERT_EQ(OpenFile(1), 0);
    WriteLine(100, 'c');
    EXPECT_EQ(FirstLetters(), "c----");
}

TEST_F(Log, LinesOfSeveralThreadsStayWholeAcrossRotations) {
    ASSERT_EQ(OpenFile(50), 0);
    std::vector<std::thread> threads;
    for (const char fill : {'a', 'b', 'c', 'd'}) {
        threads.emplace_back([fill] {
            for (int i = 0; i < 150; ++i) {
                WriteLine(4096, fill);
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    int lines = 0;
    for (const auto& entry : fs::directory_iterator(folder_.Path())) {
        std::istringstream text(test::ReadFile(entry.path()));
        for (std::string line; std::getline(text, line); ++lines) {
            ASSERT_EQ(line.size(), 4095U);
            ASSERT_EQ(line.find_first_not_of(line[kTimeSize], kTimeSize), std::string::npos);
        }
    }
    EXPECT_EQ(lines, 4 * 150);
}

}  // namespace
