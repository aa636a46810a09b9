// A whole client and a whole server: the programs as people run them, on a real rsync daemon and a
// real sshd.
#include <sys/mount.h>

#include "tests/integration/client_and_server.h"
#include "tests/support/testing.h"

using test::Ended;
using test::Must;
using test::Outcome;
using test::RunProgram;
using namespace testing;

namespace {

class PushTest : public testing::Test, public test::ClientAndServer {
protected:
    std::vector<std::string> PushCommand(const std::vector<std::string>& more,
                                         const std::string& user) {
        std::vector<std::string> command = {
            "push", "docs", "-s", "127.0.0.1", "-u", user, "--password-file", "-"};
        command.insert(command.end(), more.begin(), more.end());
        return command;
    }
    Outcome Push(const std::vector<std::string>& more = {}, const std::string& password = "secret",
                 const std::string& user = "alice") {
        return Client(PushCommand(more, user), password + "\n");
    }
    void ExpectNextPushCompletes(const std::vector<std::string>& more = {},
                                 const std::string& user = "alice") {
        EXPECT_THAT(Push(more, "secret", user), Ended(0));
        ExpectCopyIsComplete();
    }
};

TEST_F(PushTest, OnlyTheChangeTravelsAndADeletionIsOne) {
    EXPECT_THAT(Push().output,
                AllOf(HasSubstr("Paired with"), HasSubstr("3 files sent, 0 deleted")));
    ExpectCopyIsComplete();
    EXPECT_THAT(Push().output,
                AllOf(Not(HasSubstr("Paired")), HasSubstr("0 files sent, 0 deleted")));

    Write("new", "n");
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push({"--dry-run"}).output,
                AllOf(HasSubstr("send    new (1 B)"), HasSubstr("delete  a.txt")));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    EXPECT_THAT(Push().output, HasSubstr("1 file sent, 1 deleted"));
    ExpectCopyIsComplete();
    EXPECT_THAT(Server({"shares", "--json"}).output, HasSubstr("\"state\": \"complete"));
    // The one command line for both sides.
    EXPECT_THAT(RunProgram(folder_.Path("server"), {ZELCTL, "server", "shares"}),
                Ended(0, "CLIENT-1"));

    // A part of the share takes nothing else with it.
    Write("sub/c.txt", "c");
    Write("top", "t");
    EXPECT_THAT(Push({"--path", "/sub"}).output, HasSubstr("1 file sent, 0 deleted"));
    EXPECT_FALSE(fs::exists(storage_ + "/docs/top"));
    EXPECT_EQ(Push({"--path", "/no such"}).exit_code, 3);
}

TEST_F(PushTest, ADryRunAtAServerWithoutACopyChangesNothingThere) {
    EXPECT_THAT(Push({"--dry-run"}).output, HasSubstr("the server holds no copy yet"));
    EXPECT_TRUE(fs::is_empty(storage_));
    EXPECT_THAT(Server({"clients", "--json"}).output, Not(HasSubstr("CLIENT-1")));
}

TEST_F(PushTest, EachFailureHasItsOwnErrorAndTheNextPushCompletesTheCopy) {
    EXPECT_THAT(Push({}, "wrong"), Ended(1, "password"));
    EXPECT_THAT(Client({"push", "docs", "-s", "no-such-server.invalid", "-u", "alice",
                        "--password-file", "-"},
                       "secret\n"),
                Ended(1, "cannot be looked up"));
    const std::string port = "[rsync]\nport=\"" + std::to_string(port_) + "\"\n";
    Configure(port + "rsync=\"/nonexistent/rsync\"\n");
    EXPECT_THAT(Push().output, HasSubstr("/nonexistent/rsync cannot be started"));
    const std::string old = folder_.Write(
        "rsync",
        "#!/bin/sh\n[ \"$1\" = --version ] && echo 'rsync  version 3.1.3  protocol version 31' && "
        "exit\necho 'rsync: --early-input: unknown option' >&2\nexit 1\n");
    chmod(old.c_str(), 0755);
    Configure(port + "rsync=\"" + old + "\"\n");
    EXPECT_THAT(Push().output, HasSubstr("rsync 3.1.3, which is too old"));
    Configure(port);

    StopServer();
    EXPECT_THAT(Push(), Ended(1, "refused"));
    StartServer();

    Must(Server({"disable"}));
    EXPECT_THAT(Push(), Ended(4, "switched off"));
    Must(Server({"enable"}));

    fs::rename(storage_, storage_ + ".away");
    EXPECT_THAT(Push(), Ended(4, "storage folder is not there"));
    fs::rename(storage_ + ".away", storage_);
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AKilledPushAndARestartedServerLoseNothing) {
    ExpectNextPushCompletes();
    std::ofstream(source_ + "/large") << std::string(20 << 20, 'x');
    fs::remove(source_ + "/a.txt");
    // Slow enough to be caught in the middle.
    const std::vector<std::string> slow = PushCommand({"--bwlimit", "4096", "-q"}, "alice");
    for (const bool kill_server : {false, true}) {
        const auto begin = std::chrono::steady_clock::now();
        const auto after_a_second = [&] {
            return std::chrono::steady_clock::now() - begin > std::chrono::seconds(1);
        };
        if (kill_server) {
            std::thread restart([&] {
                std::this_thread::sleep_for(std::chrono::seconds(1));
                StopServer();
                StartServer();
            });
            EXPECT_EQ(Client(slow, "secret\n").exit_code, 1);
            restart.join();
        } else {
            Client(slow, "secret\n", after_a_second);
        }
        // Deletions come last, and no half file stands under its name.
        EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
        EXPECT_FALSE(fs::exists(storage_ + "/docs/large"));
        EXPECT_THAT(Server({"shares"}).output, HasSubstr("CLIENT-1"));
    }
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AnInterruptedPushEndsInOrder) {
    std::ofstream(source_ + "/large") << std::string(20 << 20, 'x');
    const std::vector<std::string> slow = PushCommand({"--bwlimit", "4096", "-q"}, "alice");
    std::thread interrupt([&] {
        std::this_thread::sleep_for(std::chrono::seconds(1));
        RunProgram("",
                   {"pkill", "-INT", "-f", "--", std::string(ZELCTL) + " push docs -s 127.0.0.1"});
    });
    EXPECT_THAT(Client(slow, "secret\n"), Ended(5, "ended by the user"));
    interrupt.join();
    // The server knows that nobody pushes any more.
    EXPECT_THAT(Server({"shares"}).output, Not(HasSubstr("being pushed")));
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AnUnreadableSourceOrAnotherVolumeNeverLeadsToDeletions) {
    ExpectNextPushCompletes();
    fs::rename(source_, source_ + ".away");
    EXPECT_EQ(Push().exit_code, 3);
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    fs::rename(source_ + ".away", source_);

    // As if the share had been added on a disk that is not mounted now: its folder is there, and
    // empty.
    const std::string catalogue = folder_.Path("client/usr/tarq/etc/tarqshare.conf");
    const std::string good = test::ReadFile(catalogue);
    std::string elsewhere = good;
    const size_t volume = elsewhere.find("volume=\"/");
    ASSERT_NE(volume, std::string::npos) << good;
    elsewhere.insert(volume + 9, "mnt/unplugged-");
    std::ofstream(catalogue) << elsewhere;
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push(), Ended(3, "not mounted where it was"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    std::ofstream(catalogue) << good;
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AFullDiskAtTheServerIsSaidAndThenHealed) {
    if (geteuid() != 0 || mkdir(folder_.Path("small").c_str(), 0755) != 0 ||
        mount("tmpfs", folder_.Path("small").c_str(), "tmpfs", 0, "size=4m") != 0) {
        GTEST_SKIP() << "needs root to mount a small disk";
    }
    Must(Server({"setup", "--storage", folder_.Path("small"), "--port", std::to_string(port_),
                 "--address", "127.0.0.1"}));
    EXPECT_EQ(Push().exit_code, 0);
    std::ofstream(source_ + "/large") << std::string(8 << 20, 'x');
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push(), Ended(1, "full"));
    EXPECT_TRUE(fs::exists(folder_.Path("small/docs/a.txt")));
    EXPECT_EQ(mount("tmpfs", folder_.Path("small").c_str(), "tmpfs", MS_REMOUNT, "size=16m"), 0);
    EXPECT_EQ(Push().exit_code, 0);
    EXPECT_EQ(fs::file_size(folder_.Path("small/docs/large")), size_t{8} << 20);
    umount2(folder_.Path("small").c_str(), MNT_DETACH);
}

TEST_F(PushTest, AnotherAccountOrClientIsKeptOut) {
    Must(Server({"account", "add", "mallory", "--password-file", "-"}, "secret\n"));
    ExpectNextPushCompletes();
    EXPECT_THAT(Push({}, "secret", "mallory"), Ended(4, "belongs to another client or account"));
    // Nor past the command line, straight at the module.
    const std::string password = folder_.Write("password", "secret\n");
    chmod(password.c_str(), 0600);
    for (const char* user : {"mallory", "alice"}) {  // alice: nothing has been started
        const Outcome written = RunProgram(
            "", {"rsync", "--password-file=" + password, "--port=" + std::to_string(port_),
                 source_ + "/a.txt", std::string(user) + "@127.0.0.1::docs/forged"});
        EXPECT_NE(written.exit_code, 0) << user;
        EXPECT_FALSE(fs::exists(storage_ + "/docs/forged"));
    }
    // A client with another identity does not get alice's share either, until the admin releases
    // it.
    folder_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"CLIENT-2\"\n");
    EXPECT_EQ(Push().exit_code, 4);
    Must(Server({"shares", "--release", "docs"}));
    ExpectNextPushCompletes();
}

TEST_F(PushTest, CommandsOfMischiefChangeNothing) {
    ExpectNextPushCompletes();
    const std::string registry = folder_.Path("server/usr/tarq/etc/tarqZEL.info");
    const std::string before = test::ReadFile(registry);
    const std::string password = folder_.Write("password", "secret\n");
    chmod(password.c_str(), 0600);
    const std::string session = std::string(32, 'b');
    const std::string head = "session=\"" + session + "\"\n";
    const std::string start =
        "command=\"ZEL_SyncStart\"\nclientID=\"CLIENT-1\"\nvolumeName=\"v\"\n";
    const std::pair<std::string, std::string> cases[] = {
        {head + start + "shareName=\"x\"\nshareName=\"y\"\n", "status=\"201\"\n"},
        {head + start + "shareName=\"x\"\ncommand=\"ZEL_Pairing\"\n", "status=\"201\"\n"},
        {head + start + "shareName=\"../../etc\"\n", "status=\"201\"\n"},
        {head + "command=\"ZEL_Pairing\"\nclientID=\"C\"\nserverName=\"x\ndryRun=\"no\"\"\ndryRun="
                "\"yes\"\n",
         "status=\"201\"\n"},
        {head + start + "shareName=\"x\"\n" + std::string(4800, '#'), "status=\"201\"\n"},
        {std::string(5000, '\xff'), ""},
        {"", ""},
    };
    for (const auto& [text, answer] : cases) {
        const std::string file = folder_.Write("command", text);
        fs::remove(folder_.Path("answer"));
        RunProgram("", {"rsync", "--early-input=" + file, "--password-file=" + password,
                        "--port=" + std::to_string(port_),
                        "alice@127.0.0.1::zel_command/" + session, folder_.Path("answer")});
        EXPECT_EQ(test::ReadFile(folder_.Path("answer")), answer) << text.substr(0, 200);
    }
    EXPECT_EQ(test::ReadFile(registry), before);
    // Answers do not pile up.
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_TRUE(fs::is_empty(folder_.Path("server/var/run/zel_server/alice")));
}

TEST_F(PushTest, SshReachesTheSameServer) {
    if (!test::SshServer::Available()) {
        GTEST_SKIP() << "this machine cannot run an ssh server for the test";
    }
    test::SshServer ssh;
    const std::string user = ssh.User();
    Must(Server({"account", "add", user, "--password-file", "-"}, "secret\n"));
    Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\nssh_options=\"-i " +
              ssh.ClientKey() + "\"\n");
    const std::vector<std::string> over_ssh = {"--ssh", "--ssh-port", std::to_string(ssh.Port())};
    ExpectNextPushCompletes(over_ssh, user);
    EXPECT_THAT(ssh.Log(), HasSubstr("Accepted publickey"));
}

}  // namespace
