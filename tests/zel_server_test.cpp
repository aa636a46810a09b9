// The server's side: what arrives from outside, and who may do what.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <random>

#include "ZEL/is_syncedshare.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/answers.h"
#include "programs/zel_server/clients.h"
#include "programs/zel_server/command.h"
#include "programs/zel_server/command_handler.h"
#include "programs/zel_server/copy_moves.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/shipped_unit.h"
#include "programs/zel_server/transfer.h"
#include "programs/zel_server/unit.h"
#include "programs/zel_server/version_retention.h"
#include "programs/zel_server/version_store.h"
#include "programs/zel_server/versions_guard.h"
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
        name + "clientID=\"ZELMULTI-SRC-SUPPORT\"\n", name + "clientID=\"a]b\"\n",
        name + "clientID=\"" + std::string(36, 'x') + "\"\n"};
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
             {ConfigFolder(), AnswerFolder(), root_.Path("storage"), root_.Path("disk2")}) {
            fs::create_directories(folder);
            fs::permissions(folder, fs::perms::owner_all);
        }
        config_.plain_port = 8873;
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
                         const std::string& dry_run = "no", const std::string& account = "alice",
                         const std::string& server_name = "nas") {
        return Do("ZEL_PairingMultiSrc",
                  {{"serverName", server_name},
                   {"syncShares", shares},
                   {"dryRun", dry_run},
                   {"outfile", "/tmp/x"},
                   {"requireEncryptionShareSupport", "no"}},
                  client, account);
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
        for (int i = 0; i < 99; ++i) {
            unsetenv(("RSYNC_ARG" + std::to_string(i)).c_str());
        }
        setenv("RSYNC_MODULE_NAME", module.c_str(), 1);
        setenv("RSYNC_USER_NAME", account.c_str(), 1);
        setenv("RSYNC_PID", std::to_string(getpid()).c_str(), 1);
        setenv("RSYNC_ARG0", "rsyncd", 1);
        setenv(kGuardVariable, "1", 1);
        for (size_t i = 0; i < arguments.size(); ++i) {
            setenv(("RSYNC_ARG" + std::to_string(i + 1)).c_str(), arguments[i].c_str(), 1);
        }
        return AdmitTransfer();
    }
    // The module in which the share can be read or compared.
    std::string Open(const std::string& share, const std::string& access,
                     const std::string& account = "alice") {
        const Answer answer =
            Do("ZEL_OpenShare", {{"shareName", share}, {"access", access}, {"outfile", "x"}}, "N",
               account);
        return answer.status == kDone ? answer.body.substr(8, answer.body.size() - 10)
                                      : std::to_string(answer.status);
    }
    // As if nothing had been heard of what is open for so long.
    static void LetPass(std::chrono::minutes time) {
        for (const auto& entry : fs::directory_iterator(OpenModules())) {
            fs::last_write_time(entry, fs::file_time_type::clock::now() - time);
        }
    }

    test::TempRoot root_;
    ServerConfig config_;
};

using Words = std::vector<std::string>;
const Words kWrite = {"--server",
                      "-blWogDtpAXre.iLsfxCIvu",
                      "--log-format=%i",
                      "--backup-dir",
                      ".zel_versions/" + std::string(32, '1'),
                      "--temp-dir",
                      ".zel_partial/" + std::string(32, '1'),
                      "--timeout=600",
                      "--bwlimit=100",
                      "--delete-after",
                      "--stats",
                      "-@-1",
                      "--numeric-ids",
                      "--info=DEL",
                      ".",
                      "."};
const Words kDelta = {"--server",
                      "-blogDtprRze.LsfxCIvu",
                      "--log-format=%i%I",
                      "--backup-dir",
                      ".zel_versions/" + std::string(32, '2'),
                      ".",
                      "/"};
const Words kDryRun = {"--server", "-nlogDtpre.iLsfxCIvu", ".", "sub/folder"};
const Words kRead = {"--server", "--sender", "-logDtpre.iLsfxCIvu", "--numeric-ids", ".", "."};
const Words kList = {"--server", "--sender", "-re.iLsfxCIvu", "--list-only", ".", "."};

TEST_F(ServerTest, AnotherClientOrAccountNeverGetsAtAShare) {
    ASSERT_EQ(Pair("A"), kDone);
    ASSERT_EQ(Pair("B", "other"), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    EXPECT_EQ(Start("docs", "B"), kConflicts);
    EXPECT_EQ(Start("DOCS", "B"), kConflicts);
    EXPECT_EQ(Start("docs", "A", "mallory"), kOtherAccount);
    EXPECT_EQ(Start("new", "A", "mallory", {{"connAccount", "alice"}}), kOtherAccount);
    EXPECT_EQ(Finish("share", "docs", "B"), kNotRunning);
    EXPECT_EQ(Finish("abort", "docs", "A", "mallory"), kNotPaired);
    ASSERT_EQ(Finish("share", "docs"), kDone);
    EXPECT_EQ(Finish("share", "docs"), kNotRunning);
    // Now that nobody pushes, the copy still belongs to A and alice.
    EXPECT_EQ(Start("docs", "B"), kConflicts);
    EXPECT_EQ(Start("Docs"), kNameTaken);
    EXPECT_EQ(Start("docs", "A", "mallory"), kOtherAccount);
    EXPECT_EQ(PairingAnswer("B", "free:docs").body, "docs\n");
    // A pairing says before what a start would say.
    for (const char* dry_run : {"yes", "no"}) {
        EXPECT_EQ(PairingAnswer("A", "Docs", dry_run).status, kNameTaken);
        EXPECT_EQ(PairingAnswer("A", "new:N ew", dry_run).body, "N ew\n");
    }
}

TEST_F(ServerTest, AnAccountHasOnlySoMuch) {
    ASSERT_EQ(Pair(), kDone);
    std::string registry = test::ReadFile(RegistryFile());
    const std::string now = std::to_string(time(nullptr));
    for (int i = 1; i < 256; ++i) {
        const std::string n = std::to_string(i);
        registry += "[SHARE_s" + n + "]\nRunningID=\"\"\nCompleteID=\"A\"\nAccount=\"alice\"\n" +
                    "Module=\"s\"\nPath=\"/s\"\nLastResult=\"\"\nLastTime=\"\"\n" +
                    "[TASK_A/alice/t" + n + "]\nstatus=\"idle\"\nLastTime=\"" + now + "\"\n";
        registry += i == 1 ? "" : "[CLIENTID_c" + n + "]\nAccounts=\"alice\"\n";
    }
    std::ofstream(RegistryFile()) << registry;
    EXPECT_EQ(PairingAnswer("A", "s1:new:newer", "yes").status, kTooManyShares);
    EXPECT_EQ(PairingAnswer("A", "s1:new:newer", "yes").body, "newer\n");
    const auto beacon = [&](const char* task, const std::string& account) {
        return Do("ZEL_UpdateTaskStatus", {{"taskName", task}}, "A", account).status;
    };
    for (const int status : {kDone, kTooManyShares}) {
        const char* const name = status == kDone ? "new" : "newer";
        EXPECT_EQ(Start(name), status);
        EXPECT_EQ(beacon(name, "alice"), status == kDone ? kDone : kTooManyTasks);
        EXPECT_EQ(Do("ZEL_Pairing", {{"dryRun", "no"}, {"serverName", "nas"}}, name).status,
                  status == kDone ? kDone : kTooManyClients);
    }
    // What there is goes on, and another account has room.
    EXPECT_EQ(Start("new"), kDone);
    EXPECT_EQ(beacon("t1", "alice"), kDone);
    EXPECT_EQ(PairingAnswer("A", "bobs", "no", "bob").status, kDone);
    EXPECT_EQ(Start("bobs", "A", "bob"), kDone);
    EXPECT_EQ(beacon("newer", "bob"), kDone);
}

TEST_F(ServerTest, WhatAClientDepositsComesBackAndNobodyPushesItOut) {
    const std::string mark(32, '0');
    const auto deposit = [&](const std::string& text, const std::string& client = "A",
                             Params more = {}) {
        more.insert({{"serverName", "nas 2"},
                     {"clientName", "attic"},
                     {"bytes", std::to_string(text.size())},
                     {"offset", "0"},
                     {"upload", mark},
                     {"text", text}});
        return Do("ZEL_DepositConfig", more, client).status;
    };
    const auto list = [&](const std::string& account = "alice") {
        std::vector<std::string> lines;
        std::istringstream body(Do("ZEL_ListDeposits", {{"outfile", "x"}}, "Z", account).body);
        for (std::string line; std::getline(body, line);) {
            lines.push_back(line);
        }
        return lines;
    };
    // The time of the n-th deposit of the list.
    const auto time_of = [&](size_t n) {
        return list().at(n).substr(2, list().at(n).find(' ', 2) - 2);
    };
    const auto fetch = [&](const std::string& time, const std::string& account = "alice") {
        return Do("ZEL_FetchDeposit", {{"depositor", "A"}, {"time", time}, {"outfile", "x"}}, "Z",
                  account);
    };

    // In pieces, none of which may be missing or come twice.
    const Params first = {{"bytes", "6"}, {"text", "a%0a"}};
    const Params last = {{"bytes", "6"}, {"offset", "2"}, {"text", "%22b=c"}};
    EXPECT_EQ(deposit("", "A", last), kBadArgument);
    EXPECT_EQ(deposit("", "A", first), kDone);
    EXPECT_TRUE(list().empty());
    EXPECT_EQ(deposit("", "A", {{"bytes", "6"}, {"offset", "3"}, {"text", "xxx"}}), kBadArgument);
    EXPECT_EQ(deposit("", "A", last), kDone);
    EXPECT_EQ(deposit("", "A", last), kBadArgument);
    EXPECT_EQ(fetch(time_of(0)).body, "a\n\"b=c");
    EXPECT_THAT(list(), ElementsAre(EndsWith(" 6 nas%202 attic")));
    EXPECT_EQ(deposit("", "A", {{"bytes", "4"}, {"text", "a%0a"}}), kDone);
    EXPECT_EQ(deposit("", "A", {{"bytes", "4"}, {"offset", "2"}, {"text", "%22%ff"}}),
              kBadArgument);
    for (const Params& bad :
         {Params{{"bytes", "1048577"}}, Params{{"upload", "../../../../../etc"}},
          Params{{"clientName", ""}}, Params{{"clientName", "\xff"}}, Params{{"text", ""}},
          Params{{"text", "%4"}}, Params{{"offset", "1"}}}) {
        EXPECT_EQ(deposit("text", "A", bad), kBadArgument);
    }
    EXPECT_EQ(fetch("../../server.conf").status, kBadArgument);
    EXPECT_EQ(fetch("1").status, kNoSuchDeposit);
    EXPECT_EQ(fetch(time_of(0), "bob").status, kNoSuchDeposit);
    EXPECT_TRUE(list("bob").empty());

    // What was there on other days outlives many of today; the same text again is no other deposit.
    const std::string folder = ConfigFolder() + "/deposits/alice/A/";
    for (const char* day : {"1", "2", "3", "4"}) {
        fs::copy(folder + time_of(0), folder + day + "00000");
    }
    for (int i = 0; i < 9; ++i) {
        EXPECT_EQ(deposit("many" + std::to_string(i)), kDone);
        EXPECT_EQ(deposit("many" + std::to_string(i)), kDone);
    }
    ASSERT_EQ(list().size(), 6u);
    EXPECT_EQ(fetch(time_of(0)).body + fetch(time_of(2)).body, "many8many6");
    EXPECT_EQ(time_of(4) + " " + time_of(5), "400000 300000");
    EXPECT_EQ(deposit("many7"), kDone);
    EXPECT_EQ(list().size(), 6u);

    // Identities that are no names of files, and as many clients as there may be.
    EXPECT_EQ(deposit("text", ".."), kDone);
    for (int i = 2; i < 16; ++i) {
        EXPECT_EQ(deposit("text", "C" + std::to_string(i)), kDone);
    }
    EXPECT_EQ(deposit("text", "D"), kTooManyDeposits);
    EXPECT_EQ(deposit("text", ".."), kDone);
    EXPECT_EQ(list().size(), 6u + 15);
    EXPECT_TRUE(fs::exists(ConfigFile()));
}

TEST_F(ServerTest, ADataRunIsLetInOnlyForTheOwningAccountToWhatIsOpen) {
    ASSERT_EQ(Pair(), kDone);
    EXPECT_NE(Admit("docs", "alice", kWrite), 0);  // not known yet
    EXPECT_EQ(Open("docs", "read"), std::to_string(kNoSuchShare));
    EXPECT_EQ(Start("docs", "B"), kNotPaired);
    ASSERT_EQ(Start("docs"), kDone);
    EXPECT_EQ(Admit("docs", "alice", kWrite), 0);
    EXPECT_EQ(Admit("docs", "alice", kDelta), 0);
    EXPECT_NE(Admit("docs", "alice", kRead), 0);
    for (const Words& run : {kWrite, kRead, kDryRun}) {
        EXPECT_NE(Admit("docs", "mallory", run), 0);
        EXPECT_NE(Admit("@docs@", "alice", run), 0);
    }
    ASSERT_EQ(Finish("share", "docs"), kDone);
    EXPECT_NE(Admit("docs", "alice", kDryRun), 0);

    const std::string reading = Open("docs", "read");
    const std::string comparing = Open("docs", "compare");
    EXPECT_EQ(Open("docs", "read"), reading);
    EXPECT_EQ(Open("docs", "read", "mallory"), std::to_string(kOtherAccount));
    EXPECT_EQ(Open("docs", "write"), std::to_string(kBadArgument));
    EXPECT_THAT(reading, Not(AnyOf("docs", comparing)));
    EXPECT_EQ(Admit(reading, "alice", kRead), 0);
    EXPECT_EQ(Admit(reading, "alice", kList), 0);
    EXPECT_EQ(Admit(reading, "alice", {"--server", "--sender", "-lWe.i", ".", "."}), 0);
    EXPECT_NE(Admit(reading, "alice", {"--server", "--sender", "-ldWe.i", ".", "."}), 0);
    EXPECT_NE(Admit(reading, "alice", kWrite), 0);
    EXPECT_NE(Admit(reading, "mallory", kRead), 0);
    EXPECT_EQ(Admit(comparing, "alice", kDryRun), 0);
    EXPECT_NE(Admit(comparing, "alice", kWrite), 0);
    EXPECT_NE(Admit(comparing, "alice", kRead), 0);
    ASSERT_EQ(TARQUISetZEL(0, nullptr, nullptr), 0);
    EXPECT_NE(Admit(reading, "alice", kRead), 0);
    EXPECT_EQ(Start("docs"), kSwitchedOff);
}

TEST_F(ServerTest, ARunThatTheClientDoesNotMakeIsRefused) {
    ASSERT_EQ(Pair(), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    for (const char* word : {"-M--sender",
                             "--suffix",
                             "--sender",
                             "--log-file=x",
                             "--temp-dir",
                             "--backup-dir",
                             "--inplace",
                             "--append",
                             "--files-from=x",
                             "--config=x",
                             "--daemon",
                             "--delete",
                             "--timeout=1x",
                             "--timeout=",
                             "--log-format=%o",
                             "--partial-dir",
                             "--list-only",
                             "--numeric-ids=1",
                             "-b",
                             "",
                             "-e.iLsfxCIvu"}) {
        Words words = kWrite;
        words.insert(words.end() - 2, word);
        EXPECT_NE(Admit("docs", "alice", words), 0) << word;
    }
    // Without versions, with the folder of another, in another place, twice, or away from the root.
    const std::string folder = ".zel_versions/" + std::string(32, '3');
    const auto admit = [&](const std::string& letters, const Words& more,
                           const std::string& path = ".") {
        Words words = {"--server", letters};
        words.insert(words.end(), more.begin(), more.end());
        words.insert(words.end(), {".", path});
        return Admit("docs", "alice", words);
    };
    EXPECT_NE(admit("-lre.i", {"--backup-dir", folder}), 0);
    EXPECT_NE(admit("-blre.i", {}), 0);
    EXPECT_NE(admit("-blre.i", {"--backup-dir", folder, "--backup-dir", folder}), 0);
    EXPECT_NE(admit("-blre.i", {"--backup-dir", folder}, "sub"), 0);
    EXPECT_NE(admit("-blre.i", {"--backup-dir", folder}, "/.zel_versions"), 0);
    for (const std::string& other : {std::string(".zel_versions"), folder + "/x", "x/" + folder,
                                     "/" + folder, std::string("old"), std::string("..")}) {
        EXPECT_NE(admit("-blre.i", {"--backup-dir", other}), 0) << other;
    }
    // Beside a file there is a part of it only when one was offered; no run has another's folder.
    for (const std::string& other : {std::string(".tarqrsync-partial"), std::string(".zel_partial"),
                                     ".zel_partial/" + std::string(32, '4')}) {
        EXPECT_NE(admit("-blre.i", {"--backup-dir", folder, "--partial-dir", other}), 0) << other;
    }
    EXPECT_EQ(admit("-blre.i", {"--backup-dir", folder}), 0);
    EXPECT_NE(admit("-blre.i", {"--backup-dir", folder}), 0);  // still in use
    // A list of changes, and folders by their entries.
    EXPECT_EQ(admit("-bldRe.i", {"--backup-dir", ".zel_versions/" + std::string(32, '5'),
                                 "--delete-after", "--delete-missing-args", "--no-r"}),
              0);
    Words hidden = {"--server", "-re.i"};
    hidden.insert(hidden.end(), 60, "--stats");
    hidden.insert(hidden.end(), {".", ".", "--sender"});
    EXPECT_NE(Admit("docs", "alice", hidden), 0);
    for (const char* letters : {"-slogDtpre.i", "-blogDtpre.i", "-llogDtpre.i", "-olgDtpre.i",
                                "-logDtpre.i-n", "-logDtpre", "-", "logDtpre.i", "-logDtprKe.i"}) {
        EXPECT_NE(Admit("docs", "alice", {"--server", letters, ".", "."}), 0) << letters;
    }
    const Words cases[] = {{},
                           {"--server"},
                           {"--server", "-re.i"},
                           {"--server", "-re.i", "."},
                           {"--server", "-re.i", ".", ".", "--sender"},
                           {"--server", "-re.i", ".", "--sender"},
                           {"--server", "-nre.i", ".", "a/../../b"},
                           {"--server", "-nre.i", "--partial-dir", "/etc", ".", "."},
                           {"--sender", "--server", "-re.i", ".", "."}};
    for (const Words& words : cases) {
        EXPECT_NE(Admit("docs", "alice", words), 0) << testing::PrintToString(words);
    }
}

TEST_F(ServerTest, WhatGivesNoSignOfLifeIsClosedByWhoeverComesNext) {
    ASSERT_EQ(Pair(), kDone);
    ASSERT_EQ(Pair("B", "other"), kDone);
    ASSERT_EQ(PairingAnswer("B", "other", "no", "bob").status, kDone);
    const auto anybody = [&] { EXPECT_EQ(Start("other", "B", "bob"), kDone); };
    const auto beacon = [&](const std::string& share, const std::string& client) {
        EXPECT_EQ(
            Do("ZEL_UpdateTaskStatus", {{"taskName", "t"}, {"shareName", share}}, client).status,
            kDone);
    };
    ASSERT_EQ(Start("docs"), kDone);
    const std::string reading = Open("docs", "read");
    LetPass(std::chrono::minutes(9));
    anybody();
    EXPECT_EQ(Admit("docs", "alice", kWrite), 0);
    // A transfer that runs keeps it open, and from its end on there are ten minutes more.
    LetPass(std::chrono::minutes(11));
    anybody();
    EXPECT_NE(Admit(reading, "alice", kRead), 0);
    setenv("RSYNC_MODULE_NAME", "docs", 1);
    setenv("RSYNC_EXIT_STATUS", "12", 1);
    EXPECT_EQ(EndTransfer(), 0);
    anybody();
    EXPECT_TRUE(IsBeingPushed("docs"));
    // A beacon of the same client that is at another share does not.
    LetPass(std::chrono::minutes(9));
    beacon("docs", "A");
    EXPECT_TRUE(IsBeingPushed("docs"));
    LetPass(std::chrono::minutes(11));
    EXPECT_FALSE(IsBeingPushed("docs"));
    beacon("other", "A");
    EXPECT_EQ(State("docs").running_id, "");
    EXPECT_EQ(State("docs").last_result, "12");
    EXPECT_EQ(Finish("share", "docs"), kNotRunning);
    EXPECT_FALSE(FindModule("docs"));
    // Nor does a process that has the number of one that is gone.
    ASSERT_EQ(Start("docs"), kDone);
    ASSERT_EQ(Admit("docs", "alice", kWrite), 0);
    std::ofstream(OpenModules() + "/docs.conf." + std::to_string(getpid())) << "1";
    LetPass(std::chrono::minutes(-11));
    EXPECT_NE(Admit("docs", "alice", kWrite), 0);
}

TEST_F(ServerTest, NamesNeverReachOutsideTheirPlace) {
    ASSERT_EQ(Pair(), kDone);
    for (const char* name :
         {"",     ".",           "..",          ".hidden", "a/b",  "../up", "a\\b",
          "a\"b", "a]b",         "a%b",         "a:b",     "a\nb", "a\x7f", " a",
          "a ",   "zel_command", "ZEL_Command", "global",  "@a@",  "#a",    "a  b"}) {
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
    ASSERT_EQ(PairingAnswer("A", "x", "no", "mallory").status, kDone);
    ASSERT_EQ(Pair("B", "y"), kDone);
    const auto is_busy = [] {
        zel_svr_status status = {};
        EXPECT_EQ(zel_svr_get_status(&status), 0);
        zel_svr_put_status(&status);
        return status.busy != 0;
    };
    EXPECT_EQ(Do("ZEL_UpdateTaskStatus", {{"taskName", "t"}}).status, kDone);
    // Another account's task of that name, or another client's, is another task.
    EXPECT_EQ(Finish("task", "t", "A", "mallory"), kDone);
    EXPECT_EQ(Finish("task", "t", "B"), kDone);
    EXPECT_TRUE(is_busy());
    EXPECT_EQ(Finish("task", "t"), kDone);
    EXPECT_FALSE(is_busy());
}

TEST_F(ServerTest, TaskStatesThatNobodyRenewsAreForgotten) {
    ASSERT_EQ(Pair(), kDone);
    const auto days_ago = [](int days) { return std::to_string(time(nullptr) - days * 86400); };
    const auto task = [&](const char* name, const std::string& last) {
        return "[TASK_" + std::string(name) + "]\nstatus=\"idle\"\n" +
               (last.empty() ? "" : "LastTime=\"" + last + "\"\n");
    };
    const std::string paired = test::ReadFile(RegistryFile());
    const auto tasks_after_beacon = [&](const std::string& swept) {
        std::ofstream(RegistryFile()) << paired + task("of an earlier version", "") +
                                             task("A/alice/old", days_ago(91)) +
                                             task("A/alice/young", days_ago(89)) +
                                             "[TaskSweep]\nLastTime=\"" + swept + "\"\n";
        EXPECT_EQ(Do("ZEL_UpdateTaskStatus", {{"taskName", "new"}}).status, kDone);
        std::vector<std::string> tasks;
        for (const std::string& name : SectionNames().value_or(std::vector<std::string>())) {
            if (name.compare(0, 5, "TASK_") == 0) {
                tasks.push_back(name.substr(5));
            }
        }
        return tasks;
    };
    EXPECT_THAT(tasks_after_beacon(days_ago(0)), SizeIs(4));  // once a day
    EXPECT_THAT(tasks_after_beacon(days_ago(2)), ElementsAre("A/alice/young", "A/alice/new"));
}

TEST_F(ServerTest, APairingHoldsForTheAccountThatHasMadeIt) {
    ASSERT_EQ(TARQUISetZEL(1, "OLD", "nas-old"), 0);
    EXPECT_EQ(IsPaired("OLD", "alice"), Paired::kYes);
    EXPECT_EQ(IsPaired("A", "alice"), Paired::kNo);
    ASSERT_EQ(Pair("A"), kDone);
    EXPECT_EQ(IsPaired("OLD", "alice"), Paired::kYes);  // also when a second one comes
    EXPECT_EQ(IsPaired("A", "alice"), Paired::kYes);
    EXPECT_EQ(IsPaired("A", "mallory"), Paired::kNo);
    EXPECT_EQ(Start("new", "A", "mallory"), kNotPaired);
    ASSERT_EQ(PairingAnswer("A", "his", "no", "mallory", "forged").status, kDone);
    EXPECT_EQ(IsPaired("A", "mallory"), Paired::kYes);
    const auto clients = PairedClients();
    ASSERT_TRUE(clients);
    EXPECT_EQ(clients->back().id + clients->back().server_name, "Anas");
    EXPECT_THAT(clients->back().accounts, ElementsAre("alice", "mallory"));
}

TEST_F(ServerTest, TheOutcomeOfADataRunIsRecordedAndAnAnswerRemoved) {
    ASSERT_EQ(Pair(), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    Admit("docs", "alice", kWrite);
    setenv("RSYNC_EXIT_STATUS", "11", 1);
    EXPECT_EQ(EndTransfer(), 0);
    EXPECT_EQ(State("docs").last_result, "11");
    setenv("RSYNC_EXIT_STATUS", "0", 1);
    setenv("RSYNC_USER_NAME", "mallory", 1);
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
        EXPECT_THAT(Open("docs", "read", "mallory"), SizeIs(3));  // a status
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

// What an earlier version wrote: a module of every share, for ever.
TEST_F(ServerTest, ModulesOfEarlierVersionsBecomeRecords) {
    const auto write = [&](const std::string& share, const std::string& owner) {
        root_.Write("usr/tarq/etc/zel_server/shares.d/" + share + ".conf",
                    owner + "[" + share + "]\n    path = " + root_.Path("storage/" + share) + "\n");
    };
    write("Docs", "# account = alice\n# client = A\n");
    write("old", "");
    root_.Write("usr/tarq/etc/zel_server/shares.d/cut.conf", "# acc");
    // Cut off in the middle of it, once.
    root_.Write("usr/tarq/etc/zel_server/shares/docs", "share=\"Do");
    ASSERT_EQ(Pair("A", "new"), kDone);
    EXPECT_TRUE(fs::is_empty(OldShareModules()));
    EXPECT_THAT(*RecordedShares(), ElementsAre("Docs", "cut", "old"));
    EXPECT_THAT(FindDamage()->ownerless, UnorderedElementsAre("cut", "old"));
    ASSERT_TRUE(MendRegistry(*FindDamage(), config_));
    EXPECT_EQ(State("Docs").account + State("Docs").path, "alice" + root_.Path("storage/Docs"));
    EXPECT_EQ(Start("docs"), kNameTaken);
    EXPECT_EQ(Start("Docs"), kDone);
}

TEST_F(ServerTest, AnOwnerThatNothingNamesIsNotMadeUp) {
    ASSERT_EQ(Pair("A"), kDone);
    ASSERT_EQ(Start("docs"), kDone);
    // As an early version wrote it.
    root_.Write("usr/tarq/etc/zel_server/shares/docs", "share=\"docs\"\nmodule=\"docs\"\npath=\"" +
                                                           root_.Path("storage/docs") +
                                                           "\"\nwhole=\"yes\"\n");
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

TEST(VersionStore, ListsWhatItHasNamedInOrderOfTime) {
    const test::TempFolder storage;
    const std::string copy = storage.Path("My Photos");
    const std::string folder = VersionsOf("My Photos", copy);
    EXPECT_EQ(folder, storage.Path(".versions/myphotos"));
    ASSERT_TRUE(ListVersions(folder));
    const std::string id(32, 'f');
    const VersionTime times[] = {{1795357680, 123456789}, {1795357680, 5}, {951782400, 0}};
    for (const VersionTime& time : times) {
        storage.Write(".versions/myphotos/" + VersionName(time, id) + "/a", "");
    }
    for (const std::string& odd :
         {"20260230T000000.000000000-" + id, "20261122T142800.12345678+-" + id,
          "2026112 T142800.000000000-" + id, "20261122T142860.000000000-" + id,
          "20261122T142800.000000000-" + std::string(32, 'F'), id}) {
        storage.Write(".versions/myphotos/" + odd + "/a", "");
    }
    const auto versions = ListVersions(folder);
    ASSERT_TRUE(versions);
    ASSERT_EQ(versions->size(), 3U);
    EXPECT_EQ((*versions)[0].path, folder + "/20000229T000000.000000000-" + id);
    EXPECT_TRUE((*versions)[1].time == times[1]);
    EXPECT_EQ((*versions)[2].path, folder + "/20261122T142800.123456789-" + id);
}

// A tree is what each path has at a time; a version says itself since when it stood there.
std::map<std::string, std::string> TreeAt(const std::string& folder, int64_t time) {
    std::map<std::string, std::string> tree;
    const auto versions = *ListVersions(folder);
    const auto moves = *ListMoves(folder);
    NamesOverTime names(moves, {time, 0});
    for (const VersionFolder& version : versions) {
        if (version.time.seconds <= time) {
            continue;
        }
        for (const auto& entry : fs::recursive_directory_iterator(version.path)) {
            const auto then = names.Until(version.time)
                                  .Then(entry.path().string().substr(version.path.size() + 1));
            if (entry.is_regular_file() && then) {
                tree.emplace(*then, test::ReadFile(entry.path()));
            }
        }
    }
    for (auto entry = tree.begin(); entry != tree.end();) {
        entry = std::stoll(entry->second) <= time ? std::next(entry) : tree.erase(entry);
    }
    return tree;
}

TEST(VersionRetention, WhatIsKeptStaysExactly) {
    EXPECT_EQ(RetentionText(*ParseRetention("weekly=2y,all=1w")), "all=7d,daily=30d,weekly=730d");
    for (const char* text : {"", "all", "all=", "all=d", "all=1", "all=1h", "none=1d", "all=-1d",
                             "all=40d", "weekly=1d", "all=1d,", "weekly=101y"}) {
        EXPECT_FALSE(ParseRetention(text)) << text;
    }
    constexpr int64_t kDay = 86400;
    const int64_t now = 20780 * kDay + 5000;
    const test::TempFolder storage;
    const std::string folder = storage.Path("v");
    std::mt19937 random(7);
    std::map<std::string, int64_t> stands;  // path -> since when
    std::string moves;
    const auto is_within = [](const std::string& path, const std::string& above) {
        return path == above || path.compare(0, above.size() + 1, above + "/") == 0;
    };
    std::vector<int64_t> times;
    for (int64_t time = now - 500 * kDay; time < now; time += 3600 * (1 + random() % 12)) {
        times.push_back(time);
    }
    for (const int64_t time : times) {
        const std::string version = "v/" + VersionName({time, 0}, base::RandomDigits()) + "/";
        fs::create_directories(storage.Path(version));
        for (int i = 0; i < 3; ++i) {
            // "d1" is a file now and a folder then.
            const std::string top = "d" + std::to_string(random() % 4);
            const std::string path =
                random() % 3 == 0 ? top : top + "/" + std::to_string(random() % 3);
            const auto goes = [&](const std::string& other) {
                return is_within(other, path) || is_within(path, other);
            };
            for (auto at = stands.begin(); at != stands.end();) {
                if (goes(at->first) && at->second < time) {
                    storage.Write(version + at->first, std::to_string(at->second));
                    at = stands.erase(at);
                } else {
                    ++at;
                }
            }
            if (std::none_of(stands.begin(), stands.end(),
                             [&](const auto& other) { return goes(other.first); })) {
                stands[path] = time;
            }
        }
        // A folder or a file that is there goes to where nothing is.
        const std::string from = "d" + std::to_string(random() % 4);
        std::string to = "d" + std::to_string(random() % 4);
        to += random() % 2 == 0 ? "" : "/" + std::to_string(random() % 3);
        std::map<std::string, int64_t> after;
        bool is_free = random() % 3 == 0 && !is_within(to, from);
        for (const auto& [path, since] : stands) {
            is_free = is_free && !is_within(path, to) && !is_within(to, path);
            after[is_within(path, from) ? to + path.substr(from.size()) : path] = since;
        }
        if (is_free && after != stands) {
            stands = after;
            moves += TimeText({time + 1, 0}) + " " + from + " " + to + " .\n";
        }
    }
    storage.Write("v/moves", moves + "12.5 cut/of");
    // The first time of a day or week, and all of the last day.
    std::map<int64_t, std::map<std::string, std::string>> before;
    std::map<std::pair<bool, int64_t>, int64_t> firsts;
    for (const int64_t time : times) {
        const int64_t age = times.back() - time;
        if (age <= kDay) {
            before[time] = TreeAt(folder, time);
        } else if (age <= 365 * kDay) {
            const bool daily = age <= 30 * kDay;
            firsts.emplace(std::pair(daily, time / kDay / (daily ? 1 : 7)), time);
        }
    }
    for (const auto& first : firsts) {
        before[first.second - 1] = TreeAt(folder, first.second - 1);
    }
    before.erase(before.begin());  // what is before the oldest may have gone
    // Killed again and again.
    auto probe = before.begin();
    for (int i = 0; i < 12; ++i) {
        const pid_t child = fork();
        if (child == 0) {
            ThinVersions(folder, Retention(), {now, 0});
            _exit(0);
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(1 + i * i));
        kill(child, SIGKILL);
        waitpid(child, nullptr, 0);
        std::advance(probe, static_cast<std::ptrdiff_t>(before.size() / 13));
        EXPECT_EQ(TreeAt(folder, probe->first), probe->second);
    }
    ASSERT_TRUE(ThinVersions(folder, Retention(), {now, 0}));
    for (const auto& [time, tree] : before) {
        EXPECT_EQ(TreeAt(folder, time), tree) << (now - time) / kDay << " days ago";
    }
    const size_t left = ListVersions(folder)->size();
    EXPECT_LT(left, 400U);  // of 1800; some for what was moved
    EXPECT_GT(left, 75U);
    EXPECT_EQ(std::distance(fs::directory_iterator(folder), {}), static_cast<long>(left + 1));
    const size_t moved = ListMoves(folder)->size();
    EXPECT_GT(moved, 30U);
    EXPECT_GT(ListMoves(folder)->front().time.seconds, now - 366 * kDay);
    // A clock that runs ahead costs nothing.
    ASSERT_TRUE(ThinVersions(folder, Retention(), {now + 4000 * kDay, 0}));
    EXPECT_EQ(ListVersions(folder)->size(), left);
    EXPECT_EQ(ListMoves(folder)->size(), moved);
}

TEST_F(ServerTest, MovesStayWithinTheCopyAndAreKnownAfterACrash) {
    ASSERT_EQ(Pair(), kDone);
    const auto move = [&](const std::string& moves, const std::string& client = "A",
                          const std::string& account = "alice") {
        const Answer answer =
            Do("ZEL_Move", {{"shareName", "docs"}, {"moves", moves}, {"outfile", "x"}}, client,
               account);
        return answer.status == kDone ? answer.body : std::to_string(answer.status);
    };
    EXPECT_EQ(move("a b"), std::to_string(kNotRunning));
    ASSERT_EQ(Start("docs"), kDone);
    const std::string copy = "storage/docs/";
    const auto there = [&](const std::string& path) {
        return fs::exists(fs::symlink_status(root_.Path(copy + path)));
    };
    for (const char* name : {"a", "b", "c", "folder/x", "taken"}) {
        root_.Write(copy + name, name);
    }
    root_.Write("outside/secret", "s");
    fs::create_symlink(root_.Path("outside"), root_.Path(copy + "link"));
    for (const char* bad : {"", "a", "a b c", "a ../b", "a /b", "a b%", "a .zel_versions/x",
                            ".zel_partial/x b", "folder/.tarqrsync-partial/x b"}) {
        EXPECT_EQ(move(bad), std::to_string(kBadArgument)) << bad;
    }
    EXPECT_EQ(move("a b", "B"), std::to_string(kNotRunning));
    EXPECT_EQ(move("a b", "A", "bob"), std::to_string(kNotRunning));
    EXPECT_EQ(move("a b"), "moved=\"0\"\n");  // something is there
    EXPECT_EQ(move("link/secret d a link/a none e folder folder/in"), "moved=\"0000\"\n");
    // A chain, folders that are not there yet, two that change places, and a name of odd bytes.
    EXPECT_EQ(move("a b2 b2 new/deep/%22%0a b tmp c b tmp c folder f2"), "moved=\"111111\"\n");
    EXPECT_TRUE(there("new/deep/\"\n") && there("f2/x") && !there("a"));
    EXPECT_EQ(test::ReadFile(root_.Path(copy + "b")), "c");
    EXPECT_FALSE(there("link/a"));
    const std::string folder = root_.Path("storage/.versions/docs");
    EXPECT_EQ(ListMoves(folder)->size(), 6U);
    // Not while a run writes into the copy.
    ASSERT_EQ(Admit("docs", "alice", kWrite), 0);
    EXPECT_EQ(move("b b3"), "moved=\"0\"\n");
    EndTransfer();
    EXPECT_EQ(move("b b3"), "moved=\"1\"\n");

    // Killed when one of two had been made.
    struct statx facts = {};
    const auto begun = [&](const std::string& path, const std::string& to) {
        statx(AT_FDCWD, root_.Path(copy + path).c_str(), 0, STATX_INO | STATX_BTIME, &facts);
        return "17.5 " + path + " " + to + " " + std::to_string(facts.stx_ino) + " " +
               TimeText({facts.stx_btime.tv_sec, static_cast<int>(facts.stx_btime.tv_nsec)}) +
               " .\n";
    };
    root_.Write("storage/.versions/docs/moving", begun("b3", "b4") + begun("c", "c4"));
    fs::rename(root_.Path(copy + "b3"), root_.Path(copy + "b4"));
    std::ofstream(folder + "/moves", std::ios::app) << "17.5 b3 b";
    EXPECT_FALSE(ListMoves(folder));  // nobody reads the past meanwhile
    ASSERT_EQ(Admit("docs", "alice", kWrite), 0);
    EndTransfer();
    EXPECT_EQ(ListMoves(folder)->size(), 8U);
    EXPECT_EQ(ListMoves(folder)->back().to, "b4");
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
    EXPECT_TRUE(EnableAccount("alice", false));
    EXPECT_TRUE(SetAccount("alice", "new"));  // does not let her in again
    EXPECT_FALSE(MayLogIn("alice"));
    EXPECT_FALSE(MayLogIn("al"));
    EXPECT_EQ(test::ReadFile(SecretsFile()), "# disabled: alice:new\nbob:two:three\n");
    EXPECT_EQ(test::ModeOf(SecretsFile()), 0600U);
    EXPECT_TRUE(EnableAccount("alice", true));
    EXPECT_TRUE(MayLogIn("alice"));
    EXPECT_TRUE(RemoveAccount("bob"));
    EXPECT_FALSE(EnableAccount("bob", true));
    EXPECT_EQ(test::ReadFile(SecretsFile()), "alice:new\n");
}

}  // namespace
