// What would lose much of a copy waits for a person: with the daemon and with push, against a real
// server. Until somebody allows it, nothing is gone.
#include <grp.h>

#include "ZEL/sync_obj.h"
#include "tests/integration/client_and_server.h"
#include "tests/integration/command.h"
#include "tests/integration/daemon_process.h"
#include "tests/support/testing.h"

using test::Await;
using test::Ended;
using test::Must;
using test::Request;
using namespace testing;
using ZEL::PObject;

namespace {

constexpr int kFiles = 300;

class BrakeTest : public testing::Test, public test::ClientAndServer {
protected:
    BrakeTest() {
        folder_.Write("client/usr/tarq/etc/zel_daemon.conf",
                      "[daemon]\ngather_ms=\"50\"\ngather_max_ms=\"1000\"\nretry_first_ms=\"200\"\n"
                      "retry_max_ms=\"600000\"\n");
        for (int i = 0; i < kFiles; ++i) {
            Write(Name(i), "photo " + std::to_string(i));
        }
    }
    static std::string Name(int i) {
        return "album/" + std::to_string(i % 10) + "/" + std::to_string(i) + ".jpg";
    }
    void AddTask(const std::string& more = "--on-change") const {
        Must(Client("task add t --share docs -s 127.0.0.1 -u alice --password-file - " + more,
                    "secret words\n"));
    }
    void Start(const std::string& more = "--on-change") {
        zel_.Start();
        AddTask(more);
        if (more != "--on-change") {
            EXPECT_THAT(Client("task run t --wait"), Ended(0));
        }
        AwaitEqual("first");
    }
    PObject Task() const { return zel_.Ask("task_show", "t")["task"]; }
    bool IsIn(ZEL::TASK_STATUS status) const { return Task()["status"].asInt32() == status; }
    void AwaitEqual(const std::string& what) const {
        EXPECT_TRUE(Await(
            [&] {
                return IsIn(ZEL::TASK_STATUS_IDLE) && Task()["pending"].asUInt64() == 0 &&
                       test::RunProgram("",
                                        {"diff", "-r", "-x", ".zel_*", source_, storage_ + "/docs"})
                               .exit_code == 0;
            },
            60))
            << what << ": " << Task().toString();
    }
    void AwaitQuestion(const std::string& text) const {
        EXPECT_TRUE(Await([&] { return IsIn(ZEL::TASK_STATUS_CONFIRM); }, 60)) << Task().toString();
        EXPECT_THAT(Task()["confirm"].asArray().front()["text"].asString(), HasSubstr(text));
    }
    /// Files of the copy that are as they were in the beginning.
    int Untouched() const {
        int untouched = 0;
        for (int i = 0; i < kFiles; ++i) {
            untouched +=
                test::ReadFile(storage_ + "/docs/" + Name(i)) == "photo " + std::to_string(i) ? 1
                                                                                              : 0;
        }
        return untouched;
    }
    uint64_t Runs() const { return zel_.Ask("task_log", "t")["runs"].asArray().size(); }

    test::DaemonProcess zel_{folder_.Path("client"), folder_.Path("zel_daemon.log")};
};

TEST_F(BrakeTest, AWrongDeletionWaitsUntilItIsConfirmedOnce) {
    Start();
    fs::remove_all(source_ + "/album");
    AwaitQuestion("a push would delete 300 and replace 0 of the 303 files of its copy");
    EXPECT_EQ(Untouched(), kFiles);
    EXPECT_THAT(Client("task list"), Ended(0, "confirm"));
    EXPECT_THAT(Client("task show t").output,
                AllOf(HasSubstr("zelctl task confirm 't' lets it go once"),
                      HasSubstr("delete  album/"), HasSubstr("... and 100 more")));
    EXPECT_THAT(Client("doctor").output, HasSubstr("zelctl task confirm 't' lets it go once"));
    EXPECT_THAT(Client("task run t --wait"), Ended(6, "300"));
    EXPECT_EQ(Untouched(), kFiles);

    // It outlives the daemon, which looks again.
    EXPECT_EQ(zel_.End(SIGKILL), -1);
    zel_.Start();
    EXPECT_THAT(Task()["confirm"].asArray(), SizeIs(1));
    AwaitQuestion("300");
    // What is below the folder comes back by itself once a person has mended it.
    for (int i = 0; i < kFiles; ++i) {
        Write(Name(i), "photo " + std::to_string(i));
    }
    Write("more", "not held up any more");
    EXPECT_THAT(Client("task run t --wait").exit_code, AnyOf(0, 6));

    fs::remove_all(source_ + "/album");
    Client("task run t --wait");
    AwaitQuestion("");
    Must(Client("task confirm t"));
    AwaitEqual("confirmed");
    EXPECT_FALSE(fs::exists(storage_ + "/docs/album"));
    EXPECT_THAT(Client("task confirm t"), Ended(3, "there is nothing to confirm"));
    // Once: the next one asks again.
    for (int i = 0; i < kFiles; ++i) {
        Write(Name(i), "photo " + std::to_string(i));
    }
    AwaitEqual("again");
    fs::remove_all(source_ + "/album");
    AwaitQuestion("300");
    EXPECT_EQ(Untouched(), kFiles);
    // No brake, no question.
    Must(Client("task edit t --brake 0"));
    AwaitEqual("no brake");
}

TEST_F(BrakeTest, AFloodIsNoticedWhateverItsForm) {
    Start("--manual");
    // Encrypted: each file is replaced by one of another name, content and time.
    for (int i = 0; i < kFiles; ++i) {
        fs::remove(source_ + "/" + Name(i));
        Write(Name(i) + ".locked", "ciphertext " + std::to_string(i));
    }
    EXPECT_THAT(Client("task run t --wait"), Ended(6, "delete 300 and replace 0 of the 303"));
    EXPECT_EQ(Untouched(), kFiles);
    // Encrypted under the same names.
    for (int i = 0; i < kFiles; ++i) {
        fs::remove(source_ + "/" + Name(i) + ".locked");
        Write(Name(i), "ciphertext " + std::to_string(i));
    }
    EXPECT_THAT(Client("task run t --wait"), Ended(6, "delete 0 and replace 300 of the 303"));
    EXPECT_EQ(Untouched(), kFiles);
    // An allowed flood holds for what was shown.
    fs::remove_all(source_ + "/album/0");
    for (const auto& entry : fs::directory_iterator(source_ + "/album")) {
        fs::remove_all(entry.path());
    }
    EXPECT_THAT(Client("task run t --wait"), Ended(6, "delete 300"));
    Must(Client("task confirm t"));
    AwaitEqual("confirmed");
}

TEST_F(BrakeTest, AFloodThatGoesOnBitByBitIsNoticed) {
    Start();
    int encrypted = 0;
    for (; encrypted < kFiles && !IsIn(ZEL::TASK_STATUS_CONFIRM); encrypted += 30) {
        const uint64_t before = Runs();
        for (int i = encrypted; i < encrypted + 30; ++i) {
            Write(Name(i), "ciphertext " + std::to_string(i));
        }
        Await([&] { return Runs() > before && !IsIn(ZEL::TASK_STATUS_RUNNING); });
    }
    AwaitQuestion("within a day");
    EXPECT_GE(Untouched(), kFiles / 2 - 2);
    // What is written again and again is one file, and temporary files are none.
    Must(Client("task confirm t"));
    AwaitEqual("confirmed");
    for (int i = 0; i < 5; ++i) {
        for (int file = 0; file < 60; ++file) {
            Write("busy/" + std::to_string(file), std::to_string(i));
        }
        AwaitEqual("busy");
        fs::remove_all(source_ + "/busy");
        AwaitEqual("busy");
    }
}

TEST_F(BrakeTest, AMoveIsNoFlood) {
    Start();
    fs::rename(source_ + "/album", source_ + "/pictures of 2026");
    AwaitEqual("renamed");
    EXPECT_FALSE(fs::exists(storage_ + "/docs/album"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/pictures of 2026/9/299.jpg"));
    // Moved away it is one, also where few changes are told.
    fs::rename(source_ + "/pictures of 2026", folder_.Path("elsewhere"));
    AwaitQuestion("delete 300");
    EXPECT_TRUE(fs::exists(storage_ + "/docs/pictures of 2026/9/299.jpg"));
    fs::rename(folder_.Path("elsewhere"), source_ + "/pictures of 2026");
    Must(Client("task run t --wait"));
    AwaitEqual("mended");
}

TEST_F(BrakeTest, AnEmptyFolderOnAMachineSetUpAnewEmptiesNoCopy) {
    const std::string push = "push docs -s 127.0.0.1 -u alice --password-file - ";
    Must(Client(push, "secret words\n"));
    EXPECT_THAT(Client(push, "secret words\n"), Ended(0, "0 files sent, 0 deleted, 31"));
    for (const auto& entry : fs::directory_iterator(source_)) {
        fs::remove_all(entry.path());
    }
    EXPECT_THAT(Client(push, "secret words\n"), Ended(6, "--confirm lets it go"));
    EXPECT_EQ(Untouched(), kFiles);

    fs::remove_all(folder_.Path("client/usr/tarq/etc/zel_shares"));  // as on a disk that is new
    zel_.Start();
    AddTask();
    AwaitQuestion("into which this machine has not pushed before");
    EXPECT_EQ(Untouched(), kFiles);
    Must(Client("task rm t"));
    EXPECT_THAT(Client(push + "--confirm", "secret words\n"), Ended(0, "deleted"));
    ExpectCopyIsComplete();
}

}  // namespace
