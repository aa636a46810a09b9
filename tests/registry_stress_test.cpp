// Many processes on one registry, for ZEL_STRESS_SECONDS (10 unless set).
#include <time.h>

#include "ZEL/is_syncedshare.h"
#include "tarq/root_path.h"
#include "tests/support/string_hash.h"
#include "tests/support/testing.h"

namespace {

using test::Hash;

constexpr int kWriters = 8;
constexpr int kReaders = 2;
constexpr int kSharesOfAWriter = 5;

/// Counts up in shares of its own: what it reads there is what it wrote last, whatever the others
/// do.
bool WriteUntil(time_t end, int writer) {
    bool kept = true;
    for (long turn = 0; kept && time(nullptr) < end; ++turn) {
        const std::string share =
            "w" + std::to_string(writer) + "_" + std::to_string(turn % kSharesOfAWriter);
        const std::string text =
            std::to_string(turn) + std::string(static_cast<size_t>(turn % 97), ' ');
        char last[256] = "";
        kept = turn < kSharesOfAWriter ||
               (ZELServerGetShare(share.c_str(), "RunningID", last, sizeof last) == 0 &&
                atol(last) == turn - kSharesOfAWriter);
        kept &= ZELServerUpdateShare(share.c_str(),
                                     Hash{{"RunningID", text}, {"CompleteID", text}}) == 0;
    }
    return kept;
}

/// Sections come whole and never go: both keys alike, and no fewer sections than before.
bool ReadUntil(time_t end) {
    const std::string path = TARQ::RootPath("/usr/tarq/etc/tarqZEL.info");
    bool whole = true;
    for (int most = 0; whole && time(nullptr) < end;) {
        const KAPICSzList sections = KAPICSzListAlloc(64);
        KAPICFileEnumSection(path.c_str(), sections);
        const int count = KAPICSzListCount(sections);
        whole = count >= most;
        for (int i = 0; i < count; ++i) {
            const Hash values;
            whole &= ZELGetServerInfo(KAPICSzListGet(sections, i), values) > 0;
            const auto all = values.All();
            whole &= all.size() == 2 && all[0].second == all[1].second;
        }
        KAPICSzListFree(sections);
        most = count;
    }
    return whole;
}

pid_t Start(const std::function<bool()>& work) {
    const pid_t child = fork();
    if (child == 0) {
        _exit(work() ? 0 : 1);
    }
    return child;
}

TEST(RegistryStress, EightWritersAndTwoReadersLoseNothingWhileHoldersOfTheLockDie) {
    const test::TempRoot root;
    const char* seconds = getenv("ZEL_STRESS_SECONDS");
    const time_t end = time(nullptr) + (seconds != nullptr ? atol(seconds) : 10);
    std::vector<pid_t> children;
    children.reserve(kWriters + kReaders);
    for (int i = 0; i < kWriters; ++i) {
        children.push_back(Start([=] { return WriteUntil(end, i); }));
    }
    for (int i = 0; i < kReaders; ++i) {
        children.push_back(Start([=] { return ReadUntil(end); }));
    }
    int deaths = 0;
    for (; time(nullptr) < end; ++deaths) {
        const pid_t holder = Start([] {
            KAPICSemLock(KAPICSemOpen(TARQ::RootSemaphoreKey(0x2980298)));
            return raise(SIGKILL) == 0;
        });
        int status = 0;
        waitpid(holder, &status, 0);
        ASSERT_TRUE(WIFSIGNALED(status));
        usleep(20'000);
    }
    for (size_t i = 0; i < children.size(); ++i) {
        int status = 0;
        waitpid(children[i], &status, 0);
        EXPECT_EQ(status, 0) << (i < kWriters ? "a writer lost an update"
                                              : "a reader saw a torn file");
    }
    EXPECT_GT(deaths, 10);
}

}  // namespace
