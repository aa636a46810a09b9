// A client that is lost, whole: what it has left with its server brings its tasks and files back.
#include <sys/mount.h>

#include "ZEL/sync_obj.h"
#include "tests/integration/client_and_server.h"
#include "tests/integration/daemon_process.h"
#include "tests/support/testing.h"

using test::Await;
using test::Ended;
using test::Must;
using namespace testing;

namespace {

class RecoverTest : public testing::Test, public test::ClientAndServer {
protected:
    ~RecoverTest() override { umount2(disk_.c_str(), MNT_DETACH); }

    // The share that lies on a disk of its own, where one may be mounted.
    bool MountDisk() const {
        fs::create_directories(disk_);
        return mount("tmpfs", disk_.c_str(), "tmpfs", 0, "size=1m") == 0;
    }
    void AddTask(const std::string& name, const std::string& shares,
                 const std::string& more) const {
        Must(Client(
            "task add " + name + " --share " + shares + " -u alice --password-file - " + more,
            "secret words\n"));
    }
    test::Outcome Recover(const std::string& more = "") const {
        return Client("recover -s 127.0.0.1 -u alice --password-file - " + more, "secret words\n");
    }
    std::string Deposits() const { return Server("deposits --json").output; }
    // A machine of this identity that was installed anew.
    void LoseClient(const std::string& identity) {
        zel_.End(SIGKILL);
        fs::remove_all(folder_.Path("client"));
        fs::remove_all(source_);
        umount2(disk_.c_str(), MNT_DETACH);
        Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\n");
        folder_.Write("client/usr/tarq/etc/tarqsdk.conf",
                      "[device]\nserial=\"" + identity + "\"\n");
        zel_.Start();
    }
    bool IsPaused(const std::string& task) const {
        return zel_.Ask("task_show", task)["task"]["status"].asInt32() == ZEL::TASK_STATUS_PAUSED;
    }

    const std::string disk_ = folder_.Path("disk");
    test::DaemonProcess zel_{folder_.Path("client"), folder_.Path("zel_daemon.log")};
};

TEST_F(RecoverTest, AMachineThatIsLostComesBackStepByStep) {
    if (!MountDisk()) {
        GTEST_SKIP() << "mounts a disk";
    }
    zel_.Start();
    folder_.Write("disk/letters/deep/l.txt", "letter");
    folder_.Write(".keys/k.txt", "key");
    Must(Client("share add letters " + disk_ + "/letters --windows"));
    Must(Client("share add keys " + folder_.Path(".keys")));
    AddTask("t", "docs letters", "-s 127.0.0.1 --on-change --exclude '*.tmp' --brake 40");
    AddTask("k", "keys", "-s 127.0.0.1 --weekly mon --at 02:30");
    AddTask("elsewhere", "docs", "-s 127.0.0.9 --plain --manual --no-check");
    Must(Client("task run k --wait"));
    const std::string before = Client("export").output;
    // As it was when all was there, and not a word of what is secret.
    const std::string deposits =
        folder_.Path("server/usr/tarq/etc/zel_server/deposits/alice/CLIENT-1");
    std::string deposit;
    ASSERT_TRUE(Await(
        [&] {
            std::error_code not_yet;
            for (const auto& file : fs::directory_iterator(deposits, not_yet)) {
                deposit = test::ReadFile(file.path());
            }
            return Matches(EndsWith(before))(deposit);
        },
        30))
        << deposit;
    EXPECT_THAT(deposit, Not(HasSubstr("secret words")));
    ASSERT_TRUE(Await([&] { return fs::exists(storage_ + "/letters/deep/l.txt"); }));
    ASSERT_TRUE(Await([&] { return Deposits().find("CLIENT-1") != std::string::npos; }));
    const std::string listed = Deposits();

    // The disk is away, and a folder is one that nobody should name from afar.
    LoseClient("CLIENT-1");
    EXPECT_THAT(Client("recover -s 127.0.0.1 -u alice --password-file - --list", "secret words\n"),
                Ended(0, "CLIENT-1"));
    EXPECT_THAT(Recover("--yes --from nobody"), Ended(2, "has left nothing there"));
    EXPECT_THAT(Recover("--yes --at '2020-01-01 00:00'"), Ended(2, "as old as"));
    EXPECT_THAT(Recover(""), Ended(2, "nobody to ask"));
    const test::Outcome first = Recover("--yes");
    EXPECT_THAT(first, Ended(1, "docs: 3 files restored"));
    EXPECT_THAT(first.output, HasSubstr("its disk was mounted at " + disk_));
    EXPECT_THAT(first.output, HasSubstr("hidden: if that is right"));
    EXPECT_FALSE(fs::exists(disk_ + "/letters"));
    EXPECT_FALSE(fs::exists(folder_.Path("client/k.txt")));
    EXPECT_TRUE(IsPaused("t") && IsPaused("k") && IsPaused("elsewhere"));
    EXPECT_THAT(zel_.Ask("task_log", "t")["runs"].asArray(), IsEmpty());
    EXPECT_EQ(test::ReadFile(storage_ + "/letters/deep/l.txt"), "letter");

    // It goes on where it was, also when it has left by now what it has so far.
    ASSERT_TRUE(MountDisk());
    Must(Client("share add keys " + folder_.Path(".keys")));
    const test::Outcome second = Recover("--yes");
    EXPECT_THAT(second, Ended(0, "Share 'docs' is back already"));
    EXPECT_EQ(test::ReadFile(disk_ + "/letters/deep/l.txt"), "letter");
    EXPECT_FALSE(IsPaused("t") || IsPaused("k"));
    EXPECT_TRUE(IsPaused("elsewhere"));
    EXPECT_EQ(Client("export").output, before);
    EXPECT_FALSE(fs::exists(folder_.Path("client/usr/tarq/etc/zel_recover")));
    Write("after.txt", "the day after");
    EXPECT_TRUE(Await([&] { return fs::exists(storage_ + "/docs/after.txt"); }));
    ExpectCopyIsComplete();
    EXPECT_EQ(Deposits(), listed);
}

TEST_F(RecoverTest, AnotherMachineIsToldWhoseCopiesTheyAre) {
    zel_.Start();
    AddTask("t", "docs", "-s 127.0.0.1 --manual");
    ASSERT_TRUE(Await([&] { return Deposits().find("CLIENT-1") != std::string::npos; }, 30));
    // A daemon that comes back has nothing to leave; one without tasks never has.
    const std::string listed = Deposits();
    LoseClient("CLIENT-2");
    EXPECT_THAT(Recover("--yes"), Ended(1, "holds no copy"));
    EXPECT_TRUE(IsPaused("t"));
    Must(Client("task resume t"));  // until then it has not got all that it is to leave
    ASSERT_TRUE(Await([&] { return Deposits().find("CLIENT-2") != std::string::npos; }, 30));
    LoseClient("CLIENT-3");
    EXPECT_THAT(Recover("--yes"), Ended(2, "say which with --from"));
    const test::Outcome outcome = Recover("--yes --from CLIENT-1");
    EXPECT_THAT(outcome.output, HasSubstr("serial=\"CLIENT-1\""));
    EXPECT_THAT(Server("deposits --remove CLIENT-2 --account alice"), Ended(0));
    EXPECT_THAT(Server("deposits --remove CLIENT-2 --account alice"), Ended(1));
    EXPECT_THAT(Deposits(), HasSubstr("CLIENT-1"));
    Must(Server("account rm alice"));
    EXPECT_FALSE(fs::exists(folder_.Path("server/usr/tarq/etc/zel_server/deposits/alice")));
}

}  // namespace
