#include <dlfcn.h>
#include <sys/ipc.h>
#include <sys/prctl.h>
#include <sys/sem.h>

#include "tarq/core.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"
#include "tests/support/string_hash.h"
#include "tests/support/syslog_capture.h"
#include "tests/support/testing.h"

// System calls that fail on demand, in front of the C library's.
namespace {

std::string failing_call;       // the call that fails
int failing_errno = 0;          // with what
std::atomic<int> reads{0};      // how often a file was read
size_t write_limit = SIZE_MAX;  // bytes that one write takes
std::atomic<time_t> clock_ahead{0};

bool Fails(const char* call) {
    if (failing_call != call) {
        return false;
    }
    errno = failing_errno;
    return true;
}

bool IsFolder(int fd) {
    struct stat status {};
    return fstat(fd, &status) == 0 && S_ISDIR(status.st_mode);
}

}  // namespace

// clang-format off
// NOLINTBEGIN(bugprone-macro-parentheses)
#define FRONT(Result, Name, Parameters, Arguments, fails)                                         \
    extern "C" __attribute__((visibility("default"))) Result Name Parameters {                    \
        static const auto next = reinterpret_cast<decltype(&Name)>(dlsym(RTLD_NEXT, #Name));      \
        return (fails) ? -1 : next Arguments;                                                     \
    }
// NOLINTEND(bugprone-macro-parentheses)
FRONT(int, fsync, (int fd), (fd), Fails(IsFolder(fd) ? "fsync folder" : "fsync"))
FRONT(int, fchmod, (int fd, mode_t mode), (fd, mode), Fails("fchmod"))
FRONT(int, renameat, (int from_folder, const char* from, int to_folder, const char* to),
      (from_folder, from, to_folder, to), Fails("renameat"))
FRONT(ssize_t, write, (int fd, const void* bytes, size_t size),
      (fd, bytes, std::min(size, write_limit)), Fails("write"))
FRONT(ssize_t, pread64, (int fd, void* bytes, size_t size, off64_t at),
      (fd, bytes, size, at), ++reads < 0 || Fails("pread"))
// clang-format on

extern "C" __attribute__((visibility("default"))) int clock_gettime(clockid_t id, timespec* now) {
    static const auto next =
        reinterpret_cast<decltype(&clock_gettime)>(dlsym(RTLD_NEXT, "clock_gettime"));
    const int result = next(id, now);
    now->tv_sec += clock_ahead;
    return result;
}

namespace {

using test::Hash;
using namespace testing;

/// The names of all sections, with a bar behind each; "failed" when they cannot be told.
std::string Sections(const std::string& path) {
    const TARQ::ListOwner list(KAPICSzListAlloc(1));
    if (KAPICFileEnumSection(path.c_str(), list.get()) < 0) {
        return "failed";
    }
    std::string names;
    for (int i = 0; i < KAPICSzListCount(list.get()); ++i) {
        names += KAPICSzListGet(list.get(), i) + std::string("|");
    }
    return names;
}

/// The value, or the error code as text.
std::string Value(const std::string& path, const char* section, const char* key) {
    char buffer[256] = "untouched";
    KAPICErrSetEx(0, "", 0);
    if (KAPICFileGetSectionValue(path.c_str(), section, key, buffer, sizeof buffer) == 0) {
        return buffer;
    }
    EXPECT_STREQ(buffer, "untouched");
    return KAPICErrText(KAPICErrGet());
}

class SectionFile : public testing::Test {
protected:
    void TearDown() override {
        failing_call.clear();
        write_limit = SIZE_MAX;
    }
    int Set(const Hash& values) const {
        return KAPICFileSetSection(file_.c_str(), "s", 0, values, nullptr);
    }
    test::TempFolder folder_;
    const std::string file_ = folder_.Path("file");
};

TEST(Containers, AHashKeepsOneValueAKeyInByteOrderAndAListItsEntriesInPlace) {
    const Hash hash{{"b", "1"}, {"\xff", "2"}, {"B", "3"}, {"", "4"}, {"b", "5"}};
    EXPECT_EQ(KAPICSzHashSetValue(hash, "b", KAPICSzHashGetValue(hash, "b")), 0) << "its own value";
    EXPECT_THAT(hash.All(), ElementsAre(std::pair("", "4"), std::pair("B", "3"),
                                        std::pair("b", "5"), std::pair("\xff", "2")));
    const TARQ::ListOwner list(KAPICSzListAlloc(1));
    KAPICSzListPush(list.get(), "first");
    const char* first = KAPICSzListGet(list.get(), 0);
    for (int i = 0; i < 1000; ++i) {
        ASSERT_EQ(KAPICSzListPush(list.get(), "more"), 0);
    }
    EXPECT_STREQ(first, "first");
    EXPECT_EQ(KAPICSzListGet(list.get(), 1001), nullptr);
    EXPECT_EQ(KAPICSzListGet(list.get(), -1), nullptr);
}

TEST(FormattedString, TakesOneStringAndPerCentSignsAlone) {
    for (const char* format : {"none", "%s%s", "%d", "%n%s", "%10s", "%s%", ""}) {
        EXPECT_EQ(KAPICStrGet(format, "x"), nullptr) << format;
    }
    EXPECT_EQ(KAPICStrGet(nullptr, "x"), nullptr);
    EXPECT_EQ(KAPICStrGet("%s", nullptr), nullptr);
    EXPECT_STREQ(TARQ::TextOwner(KAPICStrGet("100%% SHARE_%s", "a%sb")).get(), "100% SHARE_a%sb");
}

TEST(ErrorState, IsTheThreadsOwn) {
    KAPICErrSetEx(0x2200, "here", 1);
    std::thread([] {
        EXPECT_EQ(KAPICErrGet(), 0);
        KAPICErrSetEx(0xD00, "there", 2);
    }).join();
    EXPECT_EQ(KAPICErrGet(), 0x2200);
}

TEST_F(SectionFile, ReadsWhatPeopleAndOtherSystemsWrite) {
    using namespace std::string_literals;
    // clang-format off
    for (const auto& [text, expected] : std::vector<std::pair<std::string, std::string>>{
         {"[s]\nk=\"v\"\n", "v"}, {"[s]\n\tk = \"v\" \r\n", "v"},
         {"\xEF\xBB\xBF[s]\r\nk=\"v\"\r\n", "v"}, {"[s]\nk=\"v\"", "v"}, {"[s]\nk=v", "v"},
         {"[s]\nk=", ""}, {"[s]\nk=\"", "\""}, {"[s]\nk=\"a\"b\"\n", "a\"b"},
         {"[s]\nk=\"a\\\"\n", "a\\"}, {"[s]\nk=\" a=[b] \"\n", " a=[b] "},
         {" [s] # mine\n#k=\"no\"\n\n;\nk=\"v\"\n", "v"}, {"k=\"outside\"\n[s]\nk=\"v\"\n", "v"},
         {"[s]\nk=\"first\"\nk=\"second\"\n[s]\nk=\"third\"\n", "first"},
         {"[t]\nx=\"[s]\"\n[s]x]\nk=\"v\"\n", "v"}, {"[s\nk=\"lost\"\n[s]\nk=\"v\"\n", "v"},
         {"[s]\nk=\"a\0b\"\nk=\"v\"\n"s, "v"}, {"[s\0]\nk=\"lost\"\n"s, "no such section"},
         {"[S]\nk=\"v\"\n", "no such section"}, {"", "no such section"},
         {"[s]\n[t]\nk=\"v\"\n", "no such key"},
         {"[s]\nk\n=\"v\"\n\"k\"=\"v\"\n[k=\"v\"\n", "no such key"}}) {
        // clang-format on
        folder_.Write("file", text);
        EXPECT_EQ(Value(file_, "s", "k"), expected) << text;
        const bool absent = expected.substr(0, 7) == "no such";
        const Hash hash{{"k", "before"}};
        EXPECT_EQ(KAPICFileGetSection(file_.c_str(), "s", hash), expected != "no such section");
        EXPECT_EQ(KAPICSzHashGetValue(hash, "k"), absent ? "before" : expected) << text;
    }
    folder_.Write("file", "[b]\n[a]\n[]\n  [a]\n[a[]\nx[y]\n[z");
    EXPECT_EQ(Sections(file_), "b|a||a|a[|");
}

TEST_F(SectionFile, TheIndexFindsWhatTheScanFinds) {
    std::string text = "[ ]\n";
    for (int i = 0; i < 300; ++i) {  // each name twice
        text += "[n" + std::to_string(i * 7 % 150) + "]\nk=\"" + std::to_string(i) + "\"\n";
    }
    folder_.Write("file", text);
    const auto all = [this] {
        std::string values;
        for (int i = -1; i <= 150; ++i) {
            values += Value(file_, ("n" + std::to_string(i)).c_str(), "k") + "\n";
        }
        return values;
    };
    const std::string scanned = all();  // changed just now: read again each time
    EXPECT_THAT(scanned, HasSubstr("\n149\n"));
    usleep(50'000);
    const int before = reads;
    EXPECT_EQ(all(), scanned);
    std::thread other([&] { EXPECT_EQ(all(), scanned); });
    EXPECT_EQ(all(), scanned);
    other.join();
    // Or not at all: a slow machine has kept it meanwhile.
    EXPECT_LE(reads - before, 1) << "an unchanged file is read once";
}

TEST_F(SectionFile, AnEditInPlaceIsSeenAtOnce) {
    folder_.Write("file", "[s]\nk=\"000\"\n");
    const int fd = open(file_.c_str(), O_WRONLY);
    for (int i = 100; i < 600; ++i) {
        const std::string digits = std::to_string(i);
        ASSERT_EQ(pwrite(fd, digits.data(), 3, 7), 3);
        ASSERT_EQ(Value(file_, "s", "k"), digits);
        usleep(i % 100 == 0 ? 30'000 : 0);  // long enough for the file to be kept in memory
        ASSERT_EQ(Value(file_, "s", "k"), digits);
    }
    close(fd);
}

TEST_F(SectionFile, WhatIsWrittenReadsBack) {
    const Hash values{{"a", "say \"hi\""},       {"b", "c:\\"}, {"c d", " two  blanks "},
                      {"e", "\"quoted\""},       {"f", ""},     {"g", "a=b]#[c"},
                      {"h", "\xc3\xa4\xff%s%n"}, {"i", "\""}};
    for (const char* format : {static_cast<const char*>(nullptr), "\t%s=\"%s\"\n"}) {
        ASSERT_GT(KAPICFileSetSection(file_.c_str(), "x [y", 0, values, format), 0);
        Hash read;
        ASSERT_GT(KAPICFileGetSection(file_.c_str(), "x [y", read), 0);
        EXPECT_EQ(read.All(), values.All());
    }
}

TEST_F(SectionFile, WritesChangeTheirSectionAlone) {
    const std::string a = "# top\n[a]\n";
    const std::string b = "\n# about b\n[b]\nk=";
    const std::string base = a + "\tk=\"1\"\n\tl=\"2\"\n" + b + "\"3\"";
    const Hash k{{"k", "9"}};
    const Hash both{{"l", "8"}, {"m", "7"}};
    // What the file is after it was changed; the next change finds it as it was.
    const auto after = [&](int result) {
        EXPECT_EQ(result, 1);
        const std::string text = test::ReadFile(file_);
        folder_.Write("file", base);
        return text;
    };
    const char* path = file_.c_str();
    folder_.Write("file", base);
    EXPECT_EQ(after(KAPICFileSetSection(path, "a", 0, k, "\t%s=\"%s\"\n")),
              a + "\tk=\"9\"\n" + b + "\"3\"");
    EXPECT_EQ(after(KAPICIFileModifySection(path, "a", 0, both, 1, 0)),
              a + "\tk=\"1\"\n\tl=\"8\"\nm=\"7\"\n" + b + "\"3\"");
    EXPECT_EQ(after(KAPICIFileModifySection(path, "b", 0, k, 1, 0)),
              a + "\tk=\"1\"\n\tl=\"2\"\n" + b + "\"9\"\n");
    EXPECT_EQ(after(KAPICFileSetSection(path, "a", 0, Hash{}, nullptr)), a + b + "\"3\"");
    EXPECT_EQ(after(KAPICFileSetSection(path, "c", 0, k, nullptr)), base + "\n[c]\nk=\"9\"\n");
    EXPECT_EQ(KAPICIFileModifySection(path, "c", 0, k, 1, 0), 0);
    EXPECT_EQ(KAPICFileRemoveSection(path, "c"), 0);
    EXPECT_EQ(after(KAPICFileAddSection(path, "a", both, nullptr)),
              base + "\n[a]\nl=\"8\"\nm=\"7\"\n");
    folder_.Write("file", base + "\n[a]\n");  // twice: all of it is the section
    EXPECT_EQ(after(KAPICFileSetSection(path, "a", 0, k, nullptr)),
              a + "k=\"9\"\n" + b + "\"3\"\n");
    folder_.Write("file", "[a]\nk=\"1\"\nx\nk=\"2\"\n[a]\n");
    EXPECT_EQ(KAPICIFileModifySection(path, "a", 0, k, 1, 0), 1);
    EXPECT_EQ(test::ReadFile(file_), "[a]\nk=\"9\"\nx\n[a]\n");
    EXPECT_EQ(after(KAPICFileRemoveSection(path, "a")), "");
}

TEST_F(SectionFile, WhatCouldBreakTheFormatIsRefused) {
    // clang-format off
    for (const auto& [section, key, value, format] :
         std::vector<std::tuple<const char*, const char*, const char*, const char*>>{
         {"a\nb", "k", "v", "%s=%s\n"}, {"a\rb", "k", "v", "%s=%s\n"}, {"a]b", "k", "v", "%s=%s\n"},
         {"s", "", "v", nullptr}, {"s", "k=", "v", nullptr}, {"s", "\"k", "v", nullptr},
         {"s", "k\nl", "v", nullptr}, {"s", "k\r", "v", nullptr}, {"s", "#k", "v", nullptr},
         {"s", "[k", "v", nullptr}, {"s", " k", "v", nullptr}, {"s", "k", "v\nw", nullptr},
         {"s", "k", "v\r", nullptr}, {"s", "k", "v", "%s=%d\n"}, {"s", "k", "v", "%s=\"%s\""},
         {"s", "k", "v", "%s\n"}, {"s", "k", "v", "\n%s=\"%s\"\n"}, {"s", "k", "v", ""},
         {"s", "k", "\"v\"", "%s=%s\n"}, {"s", "k", "v", "x%s=\"%s\"\n"}}) {
        // clang-format on
        folder_.Write("file", "[s]\nold=\"1\"\n");
        const Hash values{{key, value}};
        const char* path = file_.c_str();
        KAPICErrSetEx(0, "", 0);
        SCOPED_TRACE(std::string(section) + "|" + key + "|" + value);
        EXPECT_EQ(KAPICFileSetSection(path, section, 0, values, format), -1);
        EXPECT_EQ(KAPICErrGet(), 0xD00);
        EXPECT_EQ(KAPICFileAddSection(path, section, values, format), -1);
        if (format == nullptr) {
            EXPECT_EQ(KAPICIFileModifySection(path, section, 0, values, 1, 0), -1);
        }
        EXPECT_EQ(test::ReadFile(file_), "[s]\nold=\"1\"\n");
    }
}

TEST_F(SectionFile, AFailureIsNotAbsence) {
    const Hash hash;
    EXPECT_EQ(Value(folder_.Path("missing"), "s", "k"), "no such section");
    fs::create_symlink("loop", folder_.Path("loop"));
    ASSERT_EQ(mkfifo(folder_.Path("pipe").c_str(), 0600), 0);
    fs::resize_file(folder_.Write("huge", "[s]\n"), (8U << 20) + 1);
    const std::string below = folder_.Write("file", "[s]\nk=\"v\"\n") + "/below";
    // clang-format off
    for (const auto& [path, error] : std::vector<std::pair<std::string, int>>{
         {folder_.Path(), EISDIR}, {folder_.Path("loop"), ELOOP}, {folder_.Path("pipe"), EINVAL},
         {folder_.Path("huge"), EFBIG}, {below, ENOTDIR}, {file_, EIO}}) {
        // clang-format on
        failing_call = path == file_ ? "pread" : "";
        failing_errno = EIO;
        EXPECT_LT(KAPICFileGetSection(path.c_str(), "s", hash), 0) << path;
        EXPECT_EQ(errno, error) << path;
        EXPECT_THAT(Value(path, "s", "k"), HasSubstr("cannot")) << path;
        EXPECT_EQ(Sections(path), "failed") << path;
        EXPECT_LT(KAPICFileSetSection(path.c_str(), "s", 0, hash, nullptr), 0) << path;
    }
}

TEST_F(SectionFile, AWriteThatFailsLeavesTheOldFileAndNothingElse) {
    const std::string old = "[s]\nk=\"old\"\n";
    folder_.Write("file", old);
    for (const char* call : {"write", "fchmod", "fsync", "renameat"}) {
        failing_call = call;
        failing_errno = ENOSPC;
        EXPECT_EQ(Set({{"k", "new"}}), -1) << call;
        EXPECT_EQ(errno, ENOSPC) << call;
        EXPECT_EQ(KAPICErrGet(), TARQ_ERR_WRITE_FILE) << call;
        EXPECT_EQ(test::ReadFile(file_), old) << call;
        const fs::directory_iterator left(folder_.Path());
        EXPECT_EQ(std::distance(begin(left), end(left)), 1) << call;
    }
    failing_call = "fsync folder";
    failing_errno = EIO;
    EXPECT_EQ(Set({{"k", "new"}}), -1);
    EXPECT_EQ(test::ReadFile(file_), "[s]\nk=\"new\"\n") << "in place, though not sure to last";
    failing_errno = EINVAL;
    write_limit = 3;
    EXPECT_EQ(Set({{"k", "newer"}}), 1);
    EXPECT_EQ(test::ReadFile(file_), "[s]\nk=\"newer\"\n") << "short writes are carried on";
}

TEST_F(SectionFile, ModeOwnerAndLinksAreKept) {
    fs::create_directory(folder_.Path("real"));
    fs::create_symlink("real/target", folder_.Path("link"));
    fs::create_symlink("link", file_);
    const mode_t mask = umask(022);
    ASSERT_EQ(KAPICFileAddSection(file_.c_str(), "s", Hash{}, nullptr), 1) << "the target is made";
    const std::string target = folder_.Path("real/target");
    EXPECT_EQ(test::ModeOf(target), 0644U);
    umask(077);
    ASSERT_EQ(chmod(target.c_str(), 0666), 0);
    const bool root = geteuid() == 0;
    ASSERT_EQ(root ? chown(target.c_str(), 12345, 23456) : 0, 0);
    ASSERT_EQ(KAPICFileAddSection(file_.c_str(), "t", Hash{}, nullptr), 1);
    umask(mask);
    struct stat status {};
    ASSERT_EQ(stat(target.c_str(), &status), 0);
    EXPECT_EQ(test::ModeOf(target), 0666U);
    EXPECT_EQ(status.st_uid, root ? 12345U : geteuid());
    EXPECT_EQ(status.st_gid, root ? 23456U : getegid());
    EXPECT_TRUE(fs::is_symlink(file_) && fs::is_symlink(folder_.Path("link")));
    EXPECT_EQ(test::ReadFile(target), "[s]\n[t]\n");
}

TEST(Semaphore, IsGivenBackByItsHolderOrByItsDeathAlone) {
    const test::TempRoot root;
    const int id = KAPICSemOpen(0x2980298);
    ASSERT_GE(id, 0);
    EXPECT_EQ(KAPICSemOpen(0x2980298), id);
    EXPECT_EQ(test::ModeOf(root.Path("run/tarqcore")), 0700U);
    ASSERT_EQ(KAPICSemLock(id), 0);
    const pid_t other = fork();
    if (other == 0) {
        const bool refused = KAPICSemUnlock(id) != 0 && errno == EPERM;
        KAPICSemLock(id);  // until the parent gives it back
        raise(refused ? SIGKILL : SIGABRT);
    }
    usleep(50'000);
    EXPECT_EQ(waitpid(other, nullptr, WNOHANG), 0) << "did not wait";
    EXPECT_EQ(KAPICSemUnlock(id), 0);
    int status = 0;
    ASSERT_EQ(waitpid(other, &status, 0), other);
    EXPECT_EQ(WTERMSIG(status), SIGKILL);
    EXPECT_EQ(KAPICSemLock(id), 0) << "the dead holder's is free again";
    std::atomic<bool> taken{false};
    std::thread thread([&] { taken = KAPICSemLock(id) == 0; });
    usleep(20'000);
    EXPECT_FALSE(taken) << "threads exclude each other, too";
    EXPECT_EQ(KAPICSemUnlock(id), 0);
    thread.join();
    EXPECT_TRUE(taken);
    EXPECT_EQ(KAPICSemUnlock(id), 0);
    EXPECT_EQ(KAPICSemUnlock(id), -1) << "not held";
    EXPECT_EQ(KAPICSemClose(id), 0);
    EXPECT_EQ(KAPICSemOpen(IPC_PRIVATE), -1);
}

TEST(Semaphore, NoOtherUserCanHoldItAndNoWaitIsWithoutEnd) {
    const test::TempRoot root;
    ASSERT_EQ(chmod(root.Path().c_str(), 0755), 0);
    const int key = TARQ::RootSemaphoreKey(0x2980298);
    const pid_t stranger = fork();
    if (stranger == 0) {  // comes first
        sembuf take = {0, 1, SEM_UNDO};
        const int id = setuid(65534) == 0 ? semget(key, 1, IPC_CREAT | 0666) : -1;
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        KAPICSemOpen(key);
        _exit(id < 0 || semop(id, &take, 1) != 0 || pause() != 0);
    }
    usleep(50'000);
    const int id = KAPICSemOpen(key);
    EXPECT_EQ(KAPICSemLock(id), 0);
    test::TakeSyslog();
    std::thread time([] {
        usleep(50'000);
        clock_ahead = 21;
    });
    EXPECT_EQ(KAPICSemLock(id), -1);
    EXPECT_EQ(errno, EWOULDBLOCK);
    EXPECT_EQ(KAPICErrGet(), TARQ_ERR_SEMAPHORE);
    EXPECT_THAT(test::TakeSyslogTexts(),
                ElementsAre(EndsWith(" was not free within 20 s: process " +
                                     std::to_string(getpid()) + " (tarqcore_test) holds it")));
    time.join();
    clock_ahead = 0;
    EXPECT_EQ(KAPICSemUnlock(id), 0);
    kill(stranger, SIGKILL);
    waitpid(stranger, nullptr, 0);
    semctl(semget(key, 0, 0), 0, IPC_RMID);

    // A folder in which others could put another file in the lock's place.
    fs::permissions(root.Path("run/tarqcore"), fs::perms::all);
    EXPECT_EQ(KAPICSemOpen(key), -1);
    EXPECT_THAT(test::TakeSyslogTexts(),
                ElementsAre(HasSubstr("run/tarqcore is not a folder that only root")));
}

std::string ReadAll(FILE* stream) {
    char text[256] = "";
    text[fread(text, 1, sizeof text - 1, stream)] = '\0';
    return text;
}

TEST(ProgramStream, RunsWithoutAShellAndWaitsForItsOwnProgram) {
    FILE* first = KAPICPopen("/bin/sh", "r", "-c", "printf '%s|' \"$@\"; exit 3", "sh", "a b",
                             "$HOME;", "", nullptr);
    FILE* second = KAPICPopen("/bin/sh", "r", "-c", "exec kill -9 $$", nullptr);
    ASSERT_TRUE(first != nullptr && second != nullptr);
    EXPECT_EQ(ReadAll(first), "a b|$HOME;||");
    EXPECT_EQ(KAPICPclose(second), SIGKILL);
    EXPECT_EQ(WEXITSTATUS(KAPICPclose(first)), 3);
    EXPECT_EQ(KAPICPclose(first), -1) << "closed already";

    const int left_open = dup(STDIN_FILENO);  // not close-on-exec
    FILE* writer = KAPICPopen("/bin/sh", "w", "-c", "read l; [ \"$l\" = hello ]", nullptr);
    FILE* list = KAPICPopen("/bin/ls", "r", "/proc/self/fd", nullptr);
    EXPECT_EQ(ReadAll(list), "0\n1\n2\n3\n") << "3 is the folder that ls reads";
    EXPECT_EQ(KAPICPclose(list), 0);
    fputs("hello\n", writer);
    EXPECT_EQ(KAPICPclose(writer), 0);
    close(left_open);

    EXPECT_EQ(KAPICPopen("/nonexistent", "r", nullptr), nullptr);
    EXPECT_EQ(errno, ENOENT);
    EXPECT_EQ(KAPICPopen("/bin/true", "rw", nullptr), nullptr);
}

TEST(PidFile, NamesALiveProcessOrNone) {
    const test::TempFolder folder;
    const pid_t zombie = fork();
    if (zombie == 0) {
        _exit(0);
    }
    siginfo_t info{};
    waitid(P_PID, static_cast<id_t>(zombie), &info, WEXITED | WNOWAIT);
    const std::string own = std::to_string(getpid());
    // clang-format off
    for (const auto& [text, alive] : std::vector<std::pair<std::string, int>>{
         {own + "\n", 1}, {own, 1}, {" " + own + " \r\nmore\n", 1}, {"1\n", 1},
         {std::to_string(zombie), 0}, {"", 0}, {"\n" + own, 0}, {own + "x", 0}, {"-" + own, 0},
         {"0", 0}, {"4194305", 0}, {"99999999999999999999", 0},
         {own + std::string(1 << 20, ' ') + "x", 0}, {std::string(1, '\0') + own, 0}}) {
        // clang-format on
        EXPECT_EQ(KAPICProcAliveByPidFile(folder.Write("pid", text).c_str()), alive)
            << text.substr(0, 40);
    }
    EXPECT_EQ(KAPICProcAliveByPidFile(folder.Path("missing").c_str()), 0);
    EXPECT_EQ(KAPICProcAliveByPidFile(folder.Path().c_str()), 0);
    waitpid(zombie, nullptr, 0);
}

TEST(Device, IsTheSmallFamilyOnlyWhenTheConfigurationSaysYes) {
    const test::TempRoot root;
    EXPECT_EQ(KAPICIsMiniUnit(), 0);
    for (const std::string value : {"yes", "yesterday", "no"}) {
        root.Write("usr/tarq/etc/tarqcore.conf", "[device]\nmini_unit=\"" + value + "\"\n");
        EXPECT_EQ(KAPICIsMiniUnit(), value == "yes") << value;
    }
}

}  // namespace
