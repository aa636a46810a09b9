#include <sched.h>
#include <sys/mount.h>
#include <sys/ptrace.h>
#include <sys/resource.h>

#include "ZEL/is_syncedshare.h"
#include "tarq/owners.h"
#include "tests/support/string_hash.h"
#include "tests/support/testing.h"

namespace {

using test::Hash;

class Crash : public testing::Test {
protected:
    std::vector<std::string> Entries() const {
        std::vector<std::string> names;
        for (const auto& entry : fs::directory_iterator(root_.Path("usr/tarq/etc"))) {
            names.push_back(entry.path().filename());
        }
        return names;
    }
    test::TempRoot root_;
    const std::string path_ = root_.Path("usr/tarq/etc/tarqZEL.info");
};

/// Lets the traced child make `calls` entries into or exits from system calls, then kills it. False
/// when it ended before.
bool KillAfter(pid_t child, int calls) {
    int status = 0;
    waitpid(child, &status, 0);
    for (int i = 0; i < calls; ++i) {
        ptrace(PTRACE_SYSCALL, child, nullptr, nullptr);
        waitpid(child, &status, 0);
        if (WIFEXITED(status)) {
            EXPECT_EQ(WEXITSTATUS(status), 0);
            return false;
        }
    }
    kill(child, SIGKILL);
    waitpid(child, &status, 0);
    return true;
}

TEST_F(Crash, AWriterKilledAtAnySystemCallLeavesTheOldFileOrTheNewOne) {
    const std::string old = "[SHARE_a]\n\tRunningID=\"old\"\n[SHARE_b]\n";
    const std::string changed = "[SHARE_a]\n\tRunningID=\"new\"\n[SHARE_b]\n";
    bool saw_old = false, saw_new = false, saw_left_over = false;
    for (int calls = 0;; ++calls) {
        root_.Write("usr/tarq/etc/tarqZEL.info", old);
        const pid_t child = fork();
        if (child == 0) {
            if (ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) != 0) {
                _exit(2);
            }
            raise(SIGSTOP);
            _exit(ZELServerUpdateShare("a", Hash{{"RunningID", "new"}}) == 0 ? 0 : 1);
        }
        if (!KillAfter(child, calls)) {
            break;
        }
        const std::string text = test::ReadFile(path_);
        EXPECT_TRUE(text == old || text == changed) << "after " << calls << " calls:\n" << text;
        saw_old |= text == old;
        saw_new |= text == changed;
        saw_left_over |= Entries().size() > 1;
        ASSERT_EQ(ZELServerUpdateShare("b", Hash{{"k", "v"}}), 0) << "the lock is free";
        EXPECT_THAT(Entries(), testing::ElementsAre("tarqZEL.info")) << "what was left is gone";
    }
    EXPECT_TRUE(saw_old && saw_new && saw_left_over);
}

TEST_F(Crash, WritersInManyProcessesLoseNothing) {
    constexpr int kWriters = 6;
    constexpr int kWrites = 50;
    std::vector<pid_t> writers(kWriters);
    for (pid_t& writer : writers) {
        writer = fork();
        for (int i = 0; writer == 0; ++i) {
            const std::string share = std::to_string(getpid()) + "." + std::to_string(i);
            const bool written = ZELServerUpdateShare(share.c_str(), Hash{{"k", "v"}}) == 0;
            if (!written || i + 1 == kWrites) {
                _exit(written ? 0 : 1);
            }
        }
    }
    for (const pid_t writer : writers) {
        int status = 0;
        EXPECT_TRUE(waitpid(writer, &status, 0) == writer && status == 0);
    }
    const TARQ::ListOwner sections(KAPICSzListAlloc(0));
    EXPECT_EQ(KAPICFileEnumSection(path_.c_str(), sections.get()), kWriters * kWrites);
}

/// Makes the folder a file system of 64 KiB, where that is allowed; otherwise no file may grow
/// beyond that.
void MakeSmall(const std::string& folder) {
    const bool mounted = unshare(CLONE_NEWNS) == 0 &&
                         mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                         mount("none", folder.c_str(), "tmpfs", 0, "size=64k") == 0;
    if (!mounted) {
        const rlimit limit{64 << 10, 64 << 10};
        signal(SIGXFSZ, SIG_IGN);
        setrlimit(RLIMIT_FSIZE, &limit);
    }
}

TEST_F(Crash, AFullDiskLeavesTheOldFile) {
    const auto fill = [this] {
        MakeSmall(root_.Path("usr/tarq/etc"));
        const Hash kilobyte{{"k", std::string(1000, 'x')}};
        int written = 0;
        while (written < 100 &&
               ZELServerUpdateShare(std::to_string(written).c_str(), kilobyte) == 0) {
            ++written;
        }
        const int error = errno;
        char last[2] = "";
        const bool readable =
            ZELServerGetShare(std::to_string(written - 1).c_str(), "k", last, 2) == 0;
        const bool clean = Entries() == std::vector<std::string>{"tarqZEL.info"};
        const bool full = written > 10 && (error == ENOSPC || error == EFBIG);
        return (full ? 0 : 1) | (readable ? 0 : 2) | (clean ? 0 : 4);
    };
    const pid_t child = fork();
    if (child == 0) {
        _exit(fill());
    }
    int status = 0;
    waitpid(child, &status, 0);
    EXPECT_EQ(status, 0) << "1 << 8: not full; 2 << 8: not readable; 4 << 8: something left over";
}

}  // namespace
