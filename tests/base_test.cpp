#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/syscall.h>

#include "base/open_beneath.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "tests/support/testing.h"

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

}  // namespace
