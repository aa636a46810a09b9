// A whole client and a whole server: the programs as people run them, on a real rsync daemon and a
// real sshd.
#include <sys/mount.h>
#include <sys/stat.h>

#include <regex>
#include <tuple>

#include "tests/integration/client_and_server.h"
#include "tests/support/testing.h"

using test::Ended;
using test::Must;
using namespace testing;

namespace {

class PushTest : public testing::Test, public test::ClientAndServer {
protected:
    test::Outcome Push(const std::string& more = "", const std::string& password = "secret",
                       const std::string& user = "alice", const std::string& before = "") const {
        return Client("push docs -s 127.0.0.1 --password-file - -u " + user + " " + more,
                      password + "\n", before);
    }
    void ExpectNextPushCompletes(const std::string& more = "",
                                 const std::string& user = "alice") const {
        EXPECT_THAT(Push(more, "secret", user), Ended(0));
        ExpectCopyIsComplete();
    }
    /// Past the command line, straight at the server.
    int Rsync(const std::string& arguments) const {
        const std::string options = " --password-file=- --port=" + std::to_string(port_) + " ";
        return test::RunProgram("", {"sh", "-c", "rsync" + options + arguments}, "secret\n")
            .exit_code;
    }
};

TEST_F(PushTest, OnlyTheChangeTravelsAndADeletionIsOne) {
    EXPECT_THAT(Push("--dry-run").output, HasSubstr("the server holds no copy yet"));
    EXPECT_TRUE(fs::is_empty(storage_));
    EXPECT_THAT(Server("clients --json").output, Not(HasSubstr("CLIENT-1")));
    EXPECT_THAT(Push().output,
                AllOf(HasSubstr("Paired with"), HasSubstr("3 files sent, 0 deleted")));
    ExpectCopyIsComplete();
    EXPECT_THAT(Push().output,
                AllOf(Not(HasSubstr("Paired")), HasSubstr("0 files sent, 0 deleted")));

    Write("new", "n");
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push("--dry-run").output,
                AllOf(HasSubstr("send    new (1 B)"), HasSubstr("delete  a.txt")));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    EXPECT_THAT(Push().output, HasSubstr("1 file sent, 1 deleted"));
    ExpectCopyIsComplete();
    EXPECT_THAT(Server("shares --json").output, HasSubstr("\"state\": \"complete"));
    // The one command line for both sides.
    EXPECT_THAT(test::Zelctl(folder_.Path("server"), "server shares"), Ended(0, "CLIENT-1"));

    // A part of the share takes nothing else with it.
    Write("sub/c.txt", "c");
    Write("top", "t");
    EXPECT_THAT(Push("--path /sub").output, HasSubstr("1 file sent, 0 deleted"));
    EXPECT_FALSE(fs::exists(storage_ + "/docs/top"));
    EXPECT_EQ(Push("--path '/no such'").exit_code, 3);

    // The share's own folder keeps its time and its mode, too.
    const auto facts = [](const std::string& folder) {
        struct stat info = {};
        stat(folder.c_str(), &info);
        return std::tuple(info.st_mtim.tv_sec, info.st_mtim.tv_nsec, info.st_mode);
    };
    chmod(source_.c_str(), 0750);
    EXPECT_THAT(Push("--path /top"), Ended(0));
    EXPECT_EQ(facts(storage_ + "/docs"), facts(source_));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/-n\n odd \xc3\xa4"));
    Write("top2", "t");
    EXPECT_THAT(Push(), Ended(0));
    EXPECT_EQ(facts(storage_ + "/docs"), facts(source_));
}

TEST_F(PushTest, OneBadShareDoesNotStopTheOthers) {
    Must(Server("account add mallory --password-file -", "secret\n"));
    for (const std::string share : {"away", "taken", "last"}) {
        folder_.Write(share + "/file", share);
        Must(Client("share add " + share + " " + folder_.Path(share)));
    }
    const auto push = [&](const std::string& shares, const std::string& user) {
        return Client("push " + shares + " -s 127.0.0.1 --password-file - -u " + user, "secret\n");
    };
    EXPECT_THAT(push("taken", "mallory"), Ended(0));
    fs::rename(folder_.Path("away"), folder_.Path("gone"));
    EXPECT_THAT(push("taken away docs last", "alice"), Ended(3, "share 'away': "));
    ExpectCopyIsComplete();
    EXPECT_TRUE(fs::exists(storage_ + "/last/file"));
    EXPECT_THAT(push("taken last", "alice"), Ended(4, "'taken': the share belongs to another"));
    EXPECT_THAT(push("away", "alice"), Ended(3, "away"));
    // Nobody there: no share is tried after the first.
    StopServer();
    const test::Outcome unreachable = push("docs last", "alice");
    EXPECT_THAT(unreachable, Ended(1, "refuses connections"));
    EXPECT_THAT(unreachable.output, Not(HasSubstr("last")));
}

TEST_F(PushTest, EachFailureHasItsOwnErrorAndTheNextPushCompletesTheCopy) {
    EXPECT_THAT(Push("", "wrong"), Ended(4, "password"));
    EXPECT_THAT(Client("push docs -s no.such.invalid -u alice --password-file -", "secret\n"),
                Ended(1, "cannot be looked up"));
    StopServer();
    EXPECT_THAT(Push(), Ended(1, "refuses"));
    StartServer();
    Must(Server("disable"));
    EXPECT_THAT(Push(), Ended(4, "switched off"));
    Must(Server("enable"));
    fs::rename(storage_, storage_ + ".away");
    EXPECT_THAT(Push(), Ended(4, "storage folder is not there"));
    fs::rename(storage_ + ".away", storage_);
    ExpectNextPushCompletes();
}

TEST_F(PushTest, APushThatIsCutOffLosesNothing) {
    ExpectNextPushCompletes();
    Write("large", std::string(32 << 20, 'x'));
    fs::remove(source_ + "/a.txt");
    const auto cut_off = [&](const std::string& how) {
        // Slow enough to be caught in the middle.
        const test::Outcome outcome = Push("--bwlimit 4096 -q", "secret", "alice", how);
        // Deletions come last, and no half file stands under its name.
        EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt")) << how;
        EXPECT_FALSE(fs::exists(storage_ + "/docs/large")) << how;
        EXPECT_THAT(Server("shares").output, HasSubstr("CLIENT-1"));
        return outcome;
    };
    EXPECT_EQ(cut_off("(sleep 1; kill -KILL $$) & ").exit_code, -1);
    std::thread restart([&] {
        std::this_thread::sleep_for(std::chrono::seconds(1));
        StopServer();
        StartServer();
    });
    EXPECT_EQ(cut_off("").exit_code, 1);
    restart.join();
    EXPECT_THAT(cut_off("(sleep 1; kill -INT $$) & "), Ended(5, "ended by the user"));
    // The server knows that nobody pushes any more.
    EXPECT_THAT(Server("shares").output, Not(HasSubstr("being pushed")));
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
    const std::regex volume("volume=\"/");
    std::ofstream(catalogue) << std::regex_replace(good, volume, "volume=\"/mnt/unplugged-");
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push(), Ended(3, "not mounted where it was"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    std::ofstream(catalogue) << good;
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AFullDiskAtTheServerIsSaidAndThenHealed) {
    if (!PutStorageOnDisk("4m")) {
        GTEST_SKIP() << "needs root to mount a small disk";
    }
    ExpectNextPushCompletes();
    Write("large", std::string(8 << 20, 'x'));
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push(), Ended(1, "full"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    EXPECT_TRUE(PutStorageOnDisk("32m"));
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AnotherAccountOrClientIsKeptOut) {
    Must(Server("account add mallory --password-file -", "secret\n"));
    ExpectNextPushCompletes();
    EXPECT_THAT(Push("", "secret", "mallory"),
                Ended(4, "'docs': the share belongs to another account"));
    for (const std::string user : {"mallory", "alice"}) {  // alice: nothing has been started
        EXPECT_NE(Rsync(source_ + "/a.txt " + user + "@127.0.0.1::docs/forged"), 0);
        EXPECT_FALSE(fs::exists(storage_ + "/docs/forged"));
    }
    // A client with another identity does not get alice's share either, until the admin releases
    // it.
    folder_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"CLIENT-2\"\n");
    EXPECT_EQ(Push().exit_code, 4);
    Must(Server("shares --release docs"));
    ExpectNextPushCompletes();
}

TEST_F(PushTest, CommandsOfMischiefChangeNothing) {
    ExpectNextPushCompletes();
    const std::string received = folder_.Path("answer");
    const std::string registry = folder_.Path("server/usr/tarq/etc/tarqZEL.info");
    const std::string before = test::ReadFile(registry);
    const std::string session(32, 'b');
    const std::string head = "session=\"" + session + "\"\n";
    const std::string start =
        head + "command=\"ZEL_SyncStart\"\nclientID=\"CLIENT-1\"\nvolumeName=\"v\"\n";
    const std::pair<std::string, std::string> cases[] = {
        {start + "shareName=\"../../etc\"\n", "status=\"201\"\n"},
        {start + "shareName=\"x\"\ncommand=\"ZEL_Pairing\"\n", "status=\"201\"\n"},
        {head + "command=\"ZEL_Pairing\"\nclientID=\"C\"\nserverName=\"x\ndryRun=\"no\"\"\n",
         "status=\"201\"\n"},
        {start + "shareName=\"x\"\n" + std::string(4800, '#'), "status=\"201\"\n"},
        {std::string(5000, '\xff'), ""},
        {"", ""},
    };
    for (const auto& [text, answer] : cases) {
        const std::string file = folder_.Write("command", text);
        fs::remove(received);
        Rsync("--early-input=" + file + " alice@127.0.0.1::zel_command/" + session + " " +
              received);
        EXPECT_EQ(test::ReadFile(received), answer) << text.substr(0, 200);
    }
    EXPECT_EQ(test::ReadFile(registry), before);
    // Answers do not pile up.
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_TRUE(fs::is_empty(folder_.Path("server/var/run/zel_server/alice")));
}

TEST_F(PushTest, StatusNamesWhatKeepsPushesOut) {
    EXPECT_THAT(Server("status --json"), Ended(0, "\"pushes_can_succeed\": true"));
    const auto expect = [&](const std::string& what, const std::string& mend) {
        EXPECT_THAT(Server("status"),
                    AllOf(Ended(1, what), Field(&test::Outcome::output, HasSubstr(mend))));
        EXPECT_NE(Push().exit_code, 0) << what;
    };
    Must(Server("disable"));
    Must(Server("setup"));  // leaves the switch, and all else, as it is
    expect("switched off", "zel_server enable");
    Must(Server("enable"));
    fs::rename(storage_, storage_ + ".away");
    expect("is not there", "mount its disk");
    fs::rename(storage_ + ".away", storage_);
    if (PutStorageOnDisk("4M")) {
        ASSERT_EQ(mount("", storage_.c_str(), "", MS_REMOUNT | MS_RDONLY, nullptr), 0);
        expect("mounted read-only", "remount,rw");
        umount2(storage_.c_str(), MNT_DETACH);
        expect("not on the disk mounted at", "run 'zel_server setup' again");
        SetUpServer();
    }
    fs::permissions(folder_.Path("server/usr/tarq/etc/zel_server/rsyncd.secrets"),
                    fs::perms::others_read, fs::perm_options::add);
    expect("open to others", "chmod 600");
    Must(Server("account rm alice"));
    expect("no account may log in", "zel_server account add");
    Must(Server("account add alice --password-file -", "secret\n"));
    EXPECT_THAT(Server("account add alice --password-file -", "secret\n"),
                Ended(0, "was there already"));
    ExpectNextPushCompletes();
    fs::remove_all(storage_ + "/docs");
    EXPECT_THAT(Server("status"), Ended(0, "no copy of 'docs' any more"));
    fs::remove_all(folder_.Path("server/usr/tarq/etc/zel_server/admin.d"));
    expect("admin.d, which the rsync daemon reads, is not there", "zel_server setup");
    Must(Server("setup"));
    ExpectNextPushCompletes();

    StopServer();
    expect("the rsync daemon is not running", "zel_server serve");
    test::ServerProcess other;
    other.Start({"python3", "-m", "http.server", std::to_string(port_), "--bind", "127.0.0.1"},
                folder_.Path("other.log"), port_);
    expect("held by python3, process ", "choose another --port");
    EXPECT_THAT(Server("setup --address 127.0.0.1 --storage " + folder_.Path("new") + " --port " +
                       std::to_string(port_)),
                Ended(1, "held by python3, process "));
    EXPECT_FALSE(fs::exists(folder_.Path("new")));
    // A set-up that could not be finished is begun anew.
    other.Stop();
    StopServer();
    const auto fresh = [&](const std::string& more) {
        return test::RunProgram(folder_.Path("fresh"),
                                {"sh", "-c",
                                 "exec " ZEL_SERVER " setup --storage " + folder_.Path("new") +
                                     " --port " + std::to_string(port_) + more});
    };
    EXPECT_THAT(fresh(" --volume v=/proc/none"), Ended(1, "cannot make the storage folder"));
    EXPECT_THAT(fresh(""), Ended(0, "zel_server serve"));
}

TEST_F(PushTest, ARegistryThatWasCutIsMendedByTheCommandThatStatusNames) {
    ExpectNextPushCompletes();
    const std::string registry = folder_.Path("server/usr/tarq/etc/tarqZEL.info");
    for (const uintmax_t size : {fs::file_size(registry) / 2, uintmax_t{0}}) {
        fs::resize_file(registry, size);
        EXPECT_THAT(Server("status"), Ended(1, "zel_server repair"));
        EXPECT_EQ(Push().exit_code, 4);
        Must(Server("repair"));
        EXPECT_THAT(Server("status"), Ended(0));
        EXPECT_THAT(Server("shares"), Ended(0, "CLIENT-1"));
        ExpectNextPushCompletes();
    }
}

TEST_F(PushTest, SshReachesTheSameServer) {
    if (!test::SshServer::Available()) {
        GTEST_SKIP() << "this machine cannot run an ssh server for the test";
    }
    test::SshServer ssh;
    const std::string user = ssh.User();
    Must(Server("account add " + user + " --password-file -", "secret\n"));
    Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\nssh_options=\"-i " +
              ssh.ClientKey() + "\"\n");
    // Whatever address the daemon was given, ssh arrives at the loopback address.
    StopServer();
    SetUpServer("127.0.0.2");
    StartServer();
    // The one daemon may answer before the other.
    for (int i = 0; i < 100 && Server("status").exit_code != 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    EXPECT_THAT(Server("status"), Ended(0, "of 127.0.0.2"));
    ExpectNextPushCompletes("--ssh --ssh-port " + std::to_string(ssh.Port()), user);
    EXPECT_THAT(ssh.Log(), HasSubstr("Accepted publickey"));
}

}  // namespace
