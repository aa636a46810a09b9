#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/syscall.h>

#include "base/file_lock.h"
#include "base/open_beneath.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "tests/support/testing.h"

namespace {

bool slow_lock = false;

}  // namespace

/// In front of the C library's: time for somebody else to come between a new file and its lock.
extern "C" int flock(int fd, int operation) {
    usleep(slow_lock ? 3000 : 0);
    return static_cast<int>(syscall(SYS_flock, fd, operation));
}

namespace {

using namespace testing;
using base::OpenBeneath;
using base::UniqueFd;

constexpr int kNotAvailable = 77;

/// From here on the kernel answers openat2() with `error`, as the filters of systemd and of
/// containers do.
bool Refuse(unsigned int error) {
    sock_filter filter[] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_openat2, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | error),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
    };
    const sock_fprog program = {static_cast<unsigned short>(std::size(filter)), filter};
    return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
           prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

/// With the kernel's own way to open (0), and with the errno by which that is refused.
class OpenBeneathTest : public TestWithParam<unsigned int> {
protected:
    OpenBeneathTest() {
        files_.Write("in/a/b/file", "inside");
        files_.Write("out/b/file", "outside");
        fs::create_symlink("../out", files_.Path("in/out"));
        fs::create_symlink("a", files_.Path("in/a_link"));
        fs::create_symlink("file", files_.Path("in/a/b/file_link"));
        in_ = UniqueFd(open(files_.Path("in").c_str(), O_RDONLY | O_DIRECTORY));
    }

    /// What is read at `path`; how it failed when it cannot be opened.
    std::string Read(const std::string& path, int flags = O_RDONLY) const {
        const UniqueFd fd = OpenBeneath(in_.Get(), path, flags);
        char text[16];
        if (!fd) {
            return strerrorname_np(errno);
        }
        const ssize_t size = read(fd.Get(), text, sizeof text);
        return size < 0 ? "unread" : std::string(text, static_cast<size_t>(size));
    }
    bool IsFolder(const std::string& path) const {
        const UniqueFd fd = OpenBeneath(in_.Get(), path, O_RDONLY | O_DIRECTORY);
        return fd && fcntl(fd.Get(), F_GETFD) == FD_CLOEXEC;
    }

    void Cases() const {
        EXPECT_EQ(Read("a/b/file"), "inside");
        EXPECT_EQ(Read("a//b/./file"), "inside");
        for (const char* folder : {"", ".", "a", "a/", "a/b/."}) {
            EXPECT_TRUE(IsFolder(folder)) << folder;
        }
        EXPECT_EQ(Read("a/none/file"), "ENOENT");
        for (const char* path : {"a/b/file/", "a/b/file/more"}) {
            EXPECT_EQ(Read(path), "ENOTDIR") << path;
        }
        for (const char* path : {"..", "../out/b/file", "a/../a/b/file", "a/b/..", "/", "/etc"}) {
            EXPECT_EQ(Read(path), "EXDEV") << path;
        }
        const auto is_link = AnyOf("ELOOP", "ENOTDIR");
        for (const char* path : {"out/b/file", "a_link/b/file", "a_link/", "a/b/file_link"}) {
            EXPECT_THAT(Read(path), is_link) << path;
        }
        EXPECT_THAT(Read("out", O_RDONLY | O_DIRECTORY), is_link);
        // The link itself may be looked at.
        const UniqueFd link = OpenBeneath(in_.Get(), "out", O_PATH);
        struct stat status = {};
        EXPECT_EQ(fstat(link.Get(), &status), 0);
        EXPECT_TRUE(S_ISLNK(status.st_mode));
    }

    /// A folder on the way and a link to another one that has the same names change places all the
    /// time.
    void Race() const {
        std::atomic<bool> done{false};
        std::thread swaps([&] {
            while (!done) {
                renameat2(in_.Get(), "a", in_.Get(), "out", RENAME_EXCHANGE);
            }
        });
        int inside = 0;
        int refused = 0;
        const auto limit = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while (inside + refused < 20000 || inside == 0 || refused == 0) {
            const std::string read = Read("a/b/file");
            read == "inside" ? ++inside : ++refused;
            if (read == "outside" || std::chrono::steady_clock::now() > limit) {
                ADD_FAILURE() << read << " after " << inside << " and " << refused;
                break;
            }
        }
        done = true;
        swaps.join();
    }

    test::TempFolder files_;
    UniqueFd in_;
};

TEST_P(OpenBeneathTest, NothingLeadsOut) {
    const pid_t child = fork();
    if (child == 0) {  // a filter is never taken away again
        if (GetParam() != 0) {
            if (!Refuse(GetParam())) {
                _exit(kNotAvailable);
            }
            EXPECT_EQ(syscall(SYS_openat2, -1, nullptr, nullptr, 0), -1);
            EXPECT_EQ(errno, static_cast<int>(GetParam()));
        }
        Cases();
        Race();
        _exit(HasFailure());
    }
    int status = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    if (WIFEXITED(status) && WEXITSTATUS(status) == kNotAvailable) {
        GTEST_SKIP() << "no filters to be had";
    }
    EXPECT_EQ(status, 0);
}

INSTANTIATE_TEST_SUITE_P(Confinement, OpenBeneathTest, Values(0u, ENOSYS, EPERM));

TEST(ReplaceFileTest, TakesTheModeThatIsGivenAndLeavesDevicesAndLinksTargetsAlone) {
    const test::TempFolder files;
    const std::string path = files.Write("file", "old");
    EXPECT_TRUE(base::ReplaceFile(path, "new", 0600));
    EXPECT_EQ(base::ReadFile(path), "new");
    EXPECT_EQ(fs::status(path).permissions(), fs::perms::owner_read | fs::perms::owner_write);
    EXPECT_EQ(base::ReadFile(path, 2), std::nullopt);
    EXPECT_EQ(errno, EFBIG);

    fs::create_symlink("file", files.Path("link"));
    EXPECT_TRUE(base::ReplaceFile(files.Path("link"), "other", 0600));
    EXPECT_EQ(base::ReadFile(path), "new");

    const std::string pipe = files.Path("pipe");
    ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
    fs::create_symlink("pipe", files.Path("to_pipe"));
    for (const std::string& name : {pipe, files.Path("to_pipe"), files.Path("missing/file")}) {
        EXPECT_FALSE(base::ReplaceFile(name, "new", 0600)) << name;
    }
    EXPECT_TRUE(fs::is_fifo(files.Path("to_pipe")));
    // Nothing is left beside them.
    EXPECT_EQ(std::distance(fs::directory_iterator(files.Path("")), fs::directory_iterator()), 4);
}

TEST(ReplaceFileTest, NobodyElseCanLockTheNewFileAndKeepItsName) {
    const test::TempFolder files;
    const std::string path = files.Path("file");
    ASSERT_EQ(chmod(files.Path().c_str(), 0755), 0);
    const pid_t stranger = fork();
    if (stranger == 0) {
        const bool other = setuid(65534) == 0;
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        for (int fd = -1; other;) {
            for (int name = 0; name < 16; ++name) {
                fd = open((files.Path(".file.tmp") + std::to_string(name)).c_str(), O_RDONLY);
                fd >= 0 && flock(fd, LOCK_EX | LOCK_NB) != 0 && close(fd) == 0;
            }
        }
        _exit(1);
    }
    slow_lock = true;
    for (int i = 0; i < 40; ++i) {
        unlink(path.c_str());
        EXPECT_TRUE(base::ReplaceFile(path, {"new"}, nullptr)) << strerror(errno);
    }
    slow_lock = false;
    EXPECT_EQ(test::ModeOf(path), 0644U);
    kill(stranger, SIGKILL);
    waitpid(stranger, nullptr, 0);
}

TEST(FileLockTest, EndsAWaitInTimeAndTakesNoStrangersFile) {
    using std::chrono::milliseconds;
    const test::TempFolder files;
    const std::string path = files.Path("lock");
    base::FileLock first(path, milliseconds(0));
    ASSERT_TRUE(first);
    EXPECT_FALSE(base::FileLock(path, milliseconds(30)));
    EXPECT_EQ(errno, EWOULDBLOCK);
    EXPECT_EQ(base::FileLock(path, milliseconds(0)).Problem(),
              path + " is not free: process " + std::to_string(getpid()) + " (base_test) holds it");
    // Who waits gets it, and not one that holds a file which has gone.
    std::thread waits([&] { EXPECT_TRUE(base::FileLock(path, std::chrono::seconds(20))); });
    usleep(20'000);
    fs::rename(path, files.Path("gone"));
    base::FileLock second(path, milliseconds(0));
    EXPECT_TRUE(second);
    first.Release();
    usleep(20'000);
    EXPECT_FALSE(base::FileLock(path, milliseconds(0)));
    second.Release();
    waits.join();

    ASSERT_EQ(chmod(path.c_str(), 0644), 0) << "anybody may open it, and so lock it";
    fs::create_symlink("gone", files.Path("link"));
    ASSERT_EQ(mkfifo(files.Path("pipe").c_str(), 0600), 0);
    files.Write("strangers", "");
    EXPECT_EQ(chmod(files.Path("strangers").c_str(), 0600), 0);
    ASSERT_EQ(geteuid() == 0 ? chown(files.Path("strangers").c_str(), 65534, 65534) : 0, 0);
    for (const char* name : {"lock", "link", "pipe", "", "missing/lock"}) {
        EXPECT_FALSE(base::FileLock(files.Path() + "/" + name, milliseconds(0))) << name;
    }
    EXPECT_EQ(base::FileLock(files.Path("strangers"), milliseconds(0)).operator bool(),
              geteuid() != 0);
}

}  // namespace
