// The server's side: what arrives from outside, and who may do what.

#include "ZEL/is_syncedshare.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/answers.h"
#include "programs/zel_server/command.h"
#include "programs/zel_server/command_handler.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/rsyncd_config.h"
#include "programs/zel_server/shipped_unit.h"
#include "programs/zel_server/transfer.h"
#include "programs/zel_server/unit.h"
#include "tests/support/testing.h"

using namespace programs;
using namespace zel_server;
using namespace testing;

namespace {

const std::string kSession(32, 'a');
const std::string kHead = "session=\"" + kSession + "\"\ncommand=\"X\"\nclientID=\"SN1\"\n";

TEST(CommandText, IsTakenToTheLetterOrRefusedWhole) {
    const auto command = ParseCommand(kHead + "name=\"a b=c\"\nempty=\"\"");
    ASSERT_TRUE(command);
    EXPECT_EQ(command->name + " of " + command->client_id, "X of SN1");
    EXPECT_EQ(*command->Find("name") + *command->Find("empty"), "a b=c");

    const std::string session = "session=\"" + kSession + "\"\n";
    const std::string name = session + "command=\"X\"\n";
    const std::string cases[] = {
        // In a line.
        kHead + "\n", kHead + "key=value\n", kHead + "key=\"v\n", kHead + "key=\"\"\"\n",
        kHead + "k=\"a\x01b\"\n", kHead + "k=\"a\rb\"\n", kHead + std::string("k=\"a\0b\"\n", 8),
        kHead + "k1=\"v\"\n", kHead + "=\"v\"\n", kHead + " k=\"v\"\n",
        kHead + "k=\"" + std::string(5 * 1024, 'x') + "\"\n",
        // Twice: a forged second one.
        kHead + "k=\"1\"\nk=\"2\"\n", kHead + "command=\"Y\"\n", kHead + "clientID=\"SN2\"\n",
        kHead + session,
        // Missing, out of order or empty.
        "", session, session + "clientID=\"SN1\"\ncommand=\"X\"\n", name + "clientID=\"\"\n",
        session + "command=\"\"\nclientID=\"SN1\"\n",
        // A client that there cannot be.
        name + "clientID=\"a]b\"\n", name + "clientID=\"" + std::string(36, 'x') + "\"\n"};
    for (const std::string& text : cases) {
        EXPECT_FALSE(ParseCommand(text)) << text;
    }
    for (const std::string& text : {std::string("session=\"../../etc/passwd\"\n"),
                                    "session=\"" + std::string(32, 'A') + "\"\n",
                                    std::string("command=\"X\"\n"), std::string()}) {
        EXPECT_FALSE(ParseSession(text)) << text;
    }
}

class ServerTest : public testing::Test {
protected:
    ServerTest() {
        for (const std::string& folder :
             {ShareModules(), AdminModules(), root_.Path("storage"), root_.Path("disk2")}) {
            fs::create_directories(folder);
        }
        config_.port = 8873;
        config_.storage = root_.Path("storage");
        config_.volumes["volume2"] = root_.Path("disk2");
        config_.program = "/usr/bin/zel_server";
        EXPECT_TRUE(SaveServerConfig(config_));
        EXPECT_NE(RecordDiskOf(config_.storage), "");
        EXPECT_NE(RecordDiskOf(root_.Path("disk2")), "");
        EXPECT_EQ(TARQUISetZEL(1, nullptr, nullptr), 0);
    }

    using Params = std::map<std::string, std::string>;

    Answer Do(const std::string& name, const Params& params, const std::string& client = "A",
              const std::string& account = "alice") {
        return Execute(config_, account, Command{name, client, params});
    }
    Answer PairingAnswer(const std::string& client, const std::string& shares,
                         const std::string& dry_run = "no") {
        return Do("ZEL_PairingMultiSrc",
                  {{"serverName", "nas"},
                   {"syncShares", shares},
                   {"dryRun", dry_run},
                   {"outfile", "/tmp/x"},
                   {"requireEncryptionShareSupport", "no"}},
                  client);
    }
    int Pair(const std::string& client = "A", const std::string& shares = "docs") {
        return PairingAnswer(client, shares).status;
    }
    int Start(const std::string& share, const std::string& client = "A",
              const std::string& account = "alice", Params more = {}) {
        more.insert({{"shareName", share}, {"volumeName", "volume1"}});
        return Do("ZEL_SyncStart", more, client, account).status;
    }
    int Finish(const std::string& type, const std::string& name, const std::string& client = "A",
               const std::string& account = "alice") {
        return Do("ZEL_SyncFinish", {{"finishType", type}, {"name", name}}, client, account).status;
    }
    ShareState State(const std::string& share) {
        ShareState state;
        ReadShare(share, state);
        return state;
    }
    // What the daemon would be told of a connection with these rsync arguments.
    int Admit(const std::string& module, const std::string& account,
              const std::vector<std::string>& arguments) {
        for (int i = 0; i < 9; ++i) {
            unsetenv(("RSYNC_ARG" + std::to_string(i)).c_str());
        }
        setenv("RSYNC_MODULE_NAME", module.c_str(), 1);
        setenv("RSYNC_USER_NAME", account.c_str(), 1);
        setenv("RSYNC_ARG0", "rsyncd", 1);
        for (size_t i = 0; i < arguments.size(); ++i) {
            setenv(("RSYNC_ARG" + std::to_string(i + 1)).c_str(), arguments[i].c_str(), 1);
        }
        return AdmitTransfer();
    }

    test::TempRoot root_;
    ServerConfig config_;
};

const std::vector<std::string> kWrite = {"--server", "-logDtpre.iLsfxCIvu", "--delete", ".", "."};
const std::vector<std::string> kDryRun = {"--server", "-nlogDtpre.iLsfxCIvu", ".", "."};
const std::vector<std::string> kRead = {"--server", "--sender", "-logDtpre.iLsfxCIvu", ".", "."};

TEST_F(ServerTest, AnotherClientOrAccountNeverGetsAtAShare) {
    ASSERT_EQ(Pair("A"), kDone);
    ASSERT_EQ(Pair("B", "other"), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    EXPECT_EQ(Start("docs", "B"), kConflicts);
    EXPECT_EQ(Start("DOCS", "B"), kConflicts);
    EXPECT_EQ(Start("docs", "A", "mallory"), kOtherAccount);
    EXPECT_EQ(Start("new", "A", "mallory", {{"connAccount", "alice"}}), kOtherAccount);
    EXPECT_EQ(Finish("share", "docs", "B"), kNotRunning);
    EXPECT_EQ(Finish("abort", "docs", "A", "mallory"), kNotRunning);
    ASSERT_EQ(Finish("share", "docs"), kDone);
    EXPECT_EQ(Finish("share", "docs"), kNotRunning);
    // Now that nobody pushes, the copy still belongs to A and alice.
    EXPECT_EQ(Start("docs", "B"), kConflicts);
    EXPECT_EQ(Start("Docs"), kNameTaken);
    EXPECT_EQ(Start("docs", "A", "mallory"), kOtherAccount);
    EXPECT_EQ(PairingAnswer("B", "free:docs").body, "docs\n");
}

TEST_F(ServerTest, ADataRunIsLetInOnlyForTheOwningAccountWhileItIsStarted) {
    ASSERT_EQ(Pair(), kDone);
    EXPECT_NE(Admit("docs", "alice", kWrite), 0);  // not known yet
    EXPECT_EQ(Start("docs", "B"), kNotPaired);
    ASSERT_EQ(Start("docs"), kDone);
    EXPECT_EQ(Admit("docs", "alice", kWrite), 0);
    EXPECT_NE(Admit("docs", "mallory", kWrite), 0);
    EXPECT_NE(Admit("docs", "mallory", kRead), 0);
    EXPECT_NE(Admit("@docs@", "alice", kWrite), 0);
    ASSERT_EQ(Finish("share", "docs"), kDone);
    EXPECT_NE(Admit("docs", "alice", kWrite), 0);
    EXPECT_EQ(Admit("docs", "alice", kRead), 0);
    EXPECT_EQ(Admit("docs", "alice", kDryRun), 0);
    // Behind the "." come paths, behind an "e" capabilities: neither makes a run harmless.
    EXPECT_NE(Admit("docs", "alice", {"--server", "-logDtpre.n", ".", "--sender"}), 0);
    ASSERT_EQ(TARQUISetZEL(0, nullptr, nullptr), 0);
    EXPECT_NE(Admit("docs", "alice", kRead), 0);
    EXPECT_EQ(Start("docs"), kSwitchedOff);
}

TEST_F(ServerTest, NamesNeverReachOutsideTheirPlace) {
    ASSERT_EQ(Pair(), kDone);
    for (const char* name :
         {"", ".", "..", ".hidden", "a/b", "../up", "a\\b", "a\"b", "a]b", "a%b", "a:b", "a\nb",
          "a\x7f", " a", "a ", "zel_command", "ZEL_Command", "global", "@a@"}) {
        EXPECT_EQ(Start(name), kBadArgument) << name;
        EXPECT_EQ(Finish("share", name), kBadArgument) << name;
    }
    EXPECT_EQ(Start(std::string(81, 'x')), kBadArgument);
    EXPECT_TRUE(fs::is_empty(root_.Path("storage")));
    // Volumes that the server does not have, nested mounts among them, mean the common folder.
    const std::pair<const char*, std::string> places[] = {{"", "storage/s"},
                                                          {"volume1", "storage/s"},
                                                          {"mnt/data", "storage/s"},
                                                          {"/etc", "storage/s"},
                                                          {"volume2", "disk2/Größe 1"}};
    for (const auto& [volume, place] : places) {
        const std::string share = fs::path(place).filename();
        EXPECT_EQ(Do("ZEL_SyncStart", {{"shareName", share}, {"volumeName", volume}}).status, kDone)
            << volume;
        EXPECT_EQ(State(share).path, root_.Path(place));
    }
}

TEST_F(ServerTest, MissingAndOddArgumentsAreRefused) {
    ASSERT_EQ(Pair(), kDone);
    const std::pair<const char*, Params> cases[] = {
        {"ZEL_GetProtocolVer", {}},
        {"ZEL_Pairing", {{"dryRun", "maybe"}, {"serverName", "x"}}},
        {"ZEL_PairingMultiSrc", {{"dryRun", "no"}}},
        {"ZEL_UpdateTaskStatus", {}},
        {"ZEL_UpdateTaskStatus", {{"taskName", "a]\n[b"}}},
        {"ZEL_SyncFinish", {{"finishType", "other"}, {"name", "docs"}}},
        {"ZEL_SyncStart", {{"shareName", "docs"}}},
        {"ZEL_SyncStart", {{"shareName", "s"}, {"volumeName", "v"}, {"isEncrypt", "2"}}},
        {"ZEL_SyncStart", {{"shareName", "s"}, {"volumeName", "v"}, {"lenEncKey", "-1"}}},
        {"ZEL_SyncStart", {{"shareName", "s"}, {"volumeName", ".."}}},
        {"ZEL_SyncStart", {{"shareName", "s"}, {"volumeName", "../x"}}},
        {"ZEL_SyncStart", {{"shareName", "s"}, {"volumeName", "a/../b"}}},
        {"ZEL_SyncStart", {{"shareName", "s"}, {"volumeName", ".x"}}},
        {"ZEL_SyncStart", {{"shareName", "s"}, {"volumeName", "a\nb"}}},
    };
    for (const auto& [command, arguments] : cases) {
        EXPECT_EQ(Do(command, arguments).status, kBadArgument)
            << command << " " << testing::PrintToString(arguments);
    }
    EXPECT_TRUE(fs::is_empty(root_.Path("storage")));
    EXPECT_EQ(Do("ZEL_Unknown", {}).status, kUnknownCommand);
    EXPECT_EQ(Pair("A", "a:..:b"), kBadArgument);
    config_.encryption = false;
    EXPECT_EQ(Start("docs", "A", "alice", {{"isEncrypt", "1"}}), kNoEncryption);
    fs::remove_all(root_.Path("storage"));
    EXPECT_EQ(Start("docs"), kStorage);
}

TEST_F(ServerTest, ABeaconShowsThatATaskRunsUntilItFinishes) {
    ASSERT_EQ(Pair(), kDone);
    for (const bool busy : {true, false}) {
        EXPECT_EQ(
            busy ? Do("ZEL_UpdateTaskStatus", {{"taskName", "t"}}).status : Finish("task", "t"),
            kDone);
        zel_svr_status status = {};
        EXPECT_EQ(zel_svr_get_status(&status), 0);
        EXPECT_EQ(status.busy, busy);
        zel_svr_put_status(&status);
    }
}

TEST_F(ServerTest, TheSingleClientStaysPairedWhenASecondComes) {
    ASSERT_EQ(TARQUISetZEL(1, "OLD", "nas-old"), 0);
    EXPECT_EQ(IsPaired("OLD"), Paired::kYes);
    EXPECT_EQ(IsPaired("A"), Paired::kNo);
    ASSERT_EQ(Pair("A"), kDone);
    EXPECT_EQ(IsPaired("OLD"), Paired::kYes);
    EXPECT_EQ(IsPaired("A"), Paired::kYes);
}

TEST_F(ServerTest, TheOutcomeOfADataRunIsRecordedAndAnAnswerRemoved) {
    ASSERT_EQ(Pair(), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    Admit("docs", "alice", kWrite);
    setenv("RSYNC_EXIT_STATUS", "11", 1);
    EXPECT_EQ(EndTransfer(), 0);
    EXPECT_EQ(State("docs").last_result, "11");
    setenv("RSYNC_EXIT_STATUS", "0", 1);
    Admit("docs", "mallory", kWrite);
    EXPECT_EQ(EndTransfer(), 0);
    EXPECT_EQ(State("docs").last_result, "11");

    ASSERT_TRUE(PrepareAnswers("alice"));
    ASSERT_TRUE(WriteAnswer("alice", kSession, "4711", {214, "docs\n"}));
    EXPECT_FALSE(WriteAnswer("alice", kSession, "4712", {0, ""}));
    const std::string folder = AnswerFolder() + "/alice";
    EXPECT_EQ(test::ReadFile(folder + "/" + kSession), "status=\"214\"\ndocs\n");
    Admit("zel_command", "alice", {});
    setenv("RSYNC_PID", "4711", 1);
    EXPECT_EQ(EndTransfer(), 0);
    EXPECT_TRUE(fs::is_empty(folder));
}

// Wherever the file may have been cut, and for a file of the same size without content.
TEST_F(ServerTest, NobodyGetsAtAShareThatTheRegistryHasLost) {
    ASSERT_EQ(Pair("A"), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    ASSERT_EQ(Finish("share", "docs"), kDone);
    ASSERT_EQ(Pair("B", "other"), kDone);
    const std::string whole = test::ReadFile(RegistryFile());
    const auto others = [&] {
        EXPECT_NE(Start("docs", "B"), kDone);
        EXPECT_NE(Start("docs", "A", "mallory"), kDone);
        EXPECT_NE(Admit("docs", "mallory", kRead), 0);
        EXPECT_NE(PairingAnswer("B", "docs", "yes").status, kDone);
    };
    std::vector<std::string> damaged = {std::string(whole.size(), '\0')};
    constexpr size_t kStep = 7;  // 1 passes too, and takes half a minute
    for (size_t size = 0; size < whole.size(); size += kStep) {
        damaged.push_back(whole.substr(0, size));
    }
    for (const std::string& content : damaged) {
        SCOPED_TRACE(content);
        root_.Write("usr/tarq/etc/tarqZEL.info", content);
        others();
        const auto damage = FindDamage();
        ASSERT_TRUE(damage);
        EXPECT_THAT(damage->ownerless, IsEmpty());
        ASSERT_TRUE(damage->None() || MendRegistry(*damage, config_));
        EXPECT_TRUE(FindDamage()->None());
        others();
        EXPECT_EQ(Pair("A"), kDone);
        EXPECT_EQ(Start("docs"), kDone);
        EXPECT_EQ(State("docs").path, root_.Path("storage/docs"));
    }
}

TEST_F(ServerTest, AnOwnerThatNothingNamesIsNotMadeUp) {
    ASSERT_EQ(Pair("A"), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    // As an earlier version wrote it.
    root_.Write("usr/tarq/etc/zel_server/shares.d/docs.conf",
                "[docs]\n    path = " + root_.Path("storage/docs") + "\n");
    root_.Write("usr/tarq/etc/tarqZEL.info", "");
    config_.switched_off = true;
    ASSERT_THAT(FindDamage()->ownerless, ElementsAre("docs"));
    ASSERT_TRUE(MendRegistry(*FindDamage(), config_));
    EXPECT_EQ(Start("docs"), kSwitchedOff);
    ASSERT_EQ(TARQUISetZEL(1, nullptr, nullptr), 0);
    EXPECT_EQ(Pair("A"), kRegistryRead);
    EXPECT_EQ(Pair("A", "other"), kDone);
    EXPECT_EQ(Start("docs"), kRegistryRead);
}

TEST(Confinement, FollowsTheUnitAndWhatTheAdminHasMadeOfIt) {
    const Confinement shipped(kShippedUnit);
    for (const char* folder : {"/tmp", "/tmp/copies", "/var/tmp/x", "/usr", "/usr/local/nas",
                               "/usr/tarq/x", "/etc/copies", "/boot/x", "/dev/shm", "/sys/x"}) {
        EXPECT_NE(shipped.Forbids(folder), "") << folder;
    }
    for (const char* folder : {"/srv/copies", "/tmpfiles", "/usrlocal", "/home/nas", "/root/x",
                               "/mnt/etc", "/usr/tarq/etc/x", "/"}) {
        EXPECT_EQ(shipped.Forbids(folder), "") << folder;
    }
    const Confinement shown(
        "ProtectSystem=strict\nProtectHome=read-only\nPrivateTmp=no\n"
        "ReadWritePaths=-/srv/copies /home/nas\nInaccessiblePaths=/srv/copies/private\n");
    EXPECT_EQ(shown.Forbids("/srv/copies/x"), "");
    EXPECT_EQ(shown.Forbids("/home/nas"), "");
    EXPECT_EQ(shown.Forbids("/home/other"), "ProtectHome=read-only");
    EXPECT_EQ(shown.Forbids("/tmp/x"), "ProtectSystem=strict");
    EXPECT_EQ(shown.Forbids("/srv/copies/private/x"), "InaccessiblePaths");
}

TEST_F(ServerTest, AccountsAreKeptInAPrivateFile) {
    EXPECT_TRUE(SetAccount("alice", "one"));
    EXPECT_TRUE(SetAccount("bob", "two:three"));
    EXPECT_TRUE(SetAccount("alice", "new"));
    EXPECT_EQ(test::ReadFile(SecretsFile()), "alice:new\nbob:two:three\n");
    EXPECT_EQ(test::ModeOf(SecretsFile()), 0600U);
    EXPECT_TRUE(RemoveAccount("alice"));
    EXPECT_EQ(test::ReadFile(SecretsFile()), "bob:two:three\n");
}

}  // namespace
