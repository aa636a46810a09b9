#include "ZEL/is_syncedshare.h"

#include <dlfcn.h>
#include <syslog.h>

#include "tests/support/string_hash.h"
#include "tests/support/syslog_capture.h"
#include "tests/support/testing.h"

namespace {

const char* failing = "";  // the platform operation that fails
int passes = 0;            // how many calls of it succeed first

bool Fails(const char* operation) {
    if (std::string(failing) != operation || passes-- > 0) {
        return false;
    }
    KAPICErrSetEx(0x123, "", 0);
    return true;
}

}  // namespace

// A platform operation that fails on demand, in front of the real one.
// NOLINTBEGIN(bugprone-macro-parentheses)
#define FRONT(Result, Name, Parameters, Arguments, failed)                                   \
    extern "C" __attribute__((visibility("default"))) Result Name Parameters {               \
        static const auto next = reinterpret_cast<decltype(&Name)>(dlsym(RTLD_NEXT, #Name)); \
        return Fails(#Name) ? (failed) : next Arguments;                                     \
    }
// NOLINTEND(bugprone-macro-parentheses)
// clang-format off
using Hash_ = KAPICSzHash;
using List_ = KAPICSzList;
using Str = const char*;
FRONT(int, KAPICSemOpen, (int key), (key), -1)
FRONT(int, KAPICSemLock, (int id), (id), -1)
FRONT(Hash_, KAPICSzHashAlloc, (int n), (n), nullptr)
FRONT(List_, KAPICSzListAlloc, (int n), (n), nullptr)
FRONT(int, KAPICSzHashSetValue, (Hash_ h, Str k, Str v), (h, k, v), -1)
FRONT(int, KAPICSzListPush, (List_ l, Str s), (l, s), -1)
FRONT(char*, KAPICStrGet, (Str f, Str a), (f, a), nullptr)
FRONT(int, KAPICFileEnumSection, (Str p, List_ l), (p, l), -1)
FRONT(int, KAPICFileGetSection, (Str p, Str s, Hash_ h), (p, s, h), -3)
FRONT(int, KAPICFileGetSectionValue, (Str p, Str s, Str k, char* b, int n), (p, s, k, b, n), -1)
FRONT(int, KAPICFileSetSection, (Str p, Str s, int r, Hash_ h, Str f), (p, s, r, h, f), -1)
FRONT(int, KAPICFileAddSection, (Str p, Str s, Hash_ h, Str f), (p, s, h, f), -1)
FRONT(int, KAPICIFileModifySection, (Str p, Str s, int r, Hash_ h, int a, int b),
      (p, s, r, h, a, b), -1)
// clang-format on

namespace {

using test::Hash;
using namespace testing;

class Registry : public testing::Test {
protected:
    Registry() { test::TakeSyslog(); }
    ~Registry() override { failing = ""; }

    /// `|` stands for a line break.
    void Write(std::string text) const {
        std::replace(text.begin(), text.end(), '|', '\n');
        root_.Write("usr/tarq/etc/tarqZEL.info", text);
    }
    std::string Text() const { return test::ReadFile(path_); }
    static void Fail(const char* operation, int after = 0) {
        failing = operation;
        passes = after;
    }
    /// The result of the check with the refused names, "214 photos music".
    static std::string Admit(const std::vector<std::string>& shares, const char* client) {
        KAPICSzList list = KAPICSzListAlloc(4), refused = KAPICSzListAlloc(4);
        KAPICSzListPush(refused, "left over");
        for (const std::string& share : shares) {
            KAPICSzListPush(list, share.c_str());
        }
        std::string result = std::to_string(ZELCheckIfSharePaired(list, client, &refused));
        for (int i = 0; i < KAPICSzListCount(refused); ++i) {
            result += std::string(" ") + KAPICSzListGet(refused, i);
        }
        KAPICSzListFree(list);
        KAPICSzListFree(refused);
        return result;
    }
    /// "enabled busy client server", with - for no text.
    static std::string Status() {
        zel_svr_status status{7, 7, nullptr, nullptr};
        std::string text = std::to_string(zel_svr_get_status(&status)) + ":";
        text += std::to_string(status.enabled) + std::to_string(status.busy);
        for (const char* part : {status.client_id, status.server_name}) {
            text += std::string(" ") + (part != nullptr ? part : "-");
        }
        zel_svr_put_status(&status);
        return text;
    }

    test::TempRoot root_;
    const std::string path_ = root_.Path("usr/tarq/etc/tarqZEL.info");
    const std::string set_error_ = "Set section [SHARE_a ] value into [" + path_ + "] error.";
};

TEST_F(Registry, IsMadeEmptyByTheFirstReaderOrWriter) {
    const mode_t mask = umask(022);
    Hash hash;
    EXPECT_EQ(ZELGetServerInfo("PairedClientInfo", hash), 0);
    umask(mask);
    EXPECT_EQ(test::ModeOf(path_), 0644U);
    EXPECT_EQ(Text(), "");

    unlink(path_.c_str());
    char buffer[8] = "";
    EXPECT_EQ(ZELServerGetShare("a", "k", buffer, 0), -1);
    EXPECT_EQ(ZELServerGetShare("a", nullptr, buffer, 8), -1);
    EXPECT_FALSE(fs::exists(path_)) << "bad arguments touch nothing";
    EXPECT_EQ(ZELServerGetShare("a", "k", buffer, 8), -1);
    EXPECT_EQ(KAPICErrGet(), 0x2200);
    EXPECT_TRUE(fs::exists(path_));

    fs::remove_all(root_.Path("usr"));
    EXPECT_EQ(ZELCheckServerInfo(), -1);
    EXPECT_LT(ZELGetServerInfo("PairedClientInfo", hash), 0);
    EXPECT_EQ(TARQUISetZEL(1, nullptr, nullptr), -1);
    EXPECT_EQ(zel_svr_reset_pair(), -1);
    EXPECT_EQ(Status(), "-1:00 - -");
}

TEST_F(Registry, AWriteReplacesTheWholeSectionOrAppendsIt) {
    EXPECT_EQ(ZELServerUpdateShare("a", Hash{{"RunningID", "A"}, {"CompleteID", "B"}}), 0);
    EXPECT_EQ(ZELServerUpdateTask("7", Hash{{"status", "idle"}}), 0);
    EXPECT_EQ(ZELServerUpdateShare("a", Hash{{"RunningID", ""}}), 0);
    EXPECT_EQ(Text(), "[SHARE_a]\n\tRunningID=\"\"\n[TASK_7]\n\tstatus=\"idle\"\n");
    Write("");
    EXPECT_EQ(ZELUpdateServerInfo("", Hash{{"k", "1"}}), 0);
    EXPECT_EQ(ZELUpdateServerInfo("", Hash{{"k", "2"}}), 0);
    EXPECT_EQ(Text(), "[]\n\tk=\"1\"\n[]\n\tk=\"2\"\n");
    EXPECT_EQ(ZELUpdateServerInfo(nullptr, Hash{}), -1);
    EXPECT_EQ(ZELServerUpdateShare(nullptr, Hash{}), -1);
    EXPECT_THAT(test::TakeSyslogTexts(), IsEmpty());
}

TEST_F(Registry, AWriteThatFailsSaysWhatFailed) {
    const std::string at = "[" + path_ + "]", code = ", section=[SHARE_a], errno=[0x0123]";
    const std::string locked = "ZELUpdateServerInfo() lock failed";
    const std::string read =
        "KAPICFileGetSection error. filePath:" + at + " szOldSecName:[SHARE_a]  iRet:[-3]";
    const std::string set = "KAPICFileSetSection() failed!! szFile=" + at + code;
    const std::string add = "KAPICFileAddSection() failed!! szFile=" + at + code;
    using Log = std::vector<std::string>;
    // clang-format off
    for (const auto& [operation, old, log] : std::vector<std::tuple<Str, Str, Log>>{
         {"KAPICSemOpen", "[SHARE_a]\n", {locked}}, {"KAPICSemLock", "[SHARE_a]\n", {locked}},
         {"KAPICSzHashAlloc", "[SHARE_a]\n", {set_error_}},
         {"KAPICFileGetSection", "[SHARE_a]\n", {read, set_error_}},
         {"KAPICFileSetSection", "[SHARE_a]\n", {set, set_error_}},
         {"KAPICFileAddSection", "", {add, set_error_}}}) {
        // clang-format on
        Write(old);
        const Hash values{{"k", "v"}};
        Fail(operation);
        EXPECT_EQ(ZELServerUpdateShare("a", values), -1) << operation;
        failing = "";
        EXPECT_EQ(test::TakeSyslogTexts(), log);
        EXPECT_EQ(Text(), old);
        EXPECT_EQ(ZELServerUpdateShare("a", values), 0) << "the lock was given back";
    }
    fs::remove_all(root_.Path("usr"));
    EXPECT_EQ(ZELServerUpdateShare("a", Hash{}), -1);
    const std::string opened =
        "Failed to open file " + at + ", errno=[2/No such file or directory]";
    EXPECT_THAT(test::TakeSyslogTexts(), ElementsAre(opened, set_error_));
    root_.Write("usr", "in the way");
    EXPECT_EQ(ZELUpdateServerInfo("", Hash{}), -1);
    const auto log = test::TakeSyslog();
    ASSERT_EQ(log.size(), 2U);
    EXPECT_EQ(log[0].text, "Failed to stat file " + at + ", errno=[20/Not a directory]");
    EXPECT_EQ(log[0].priority, LOG_ERR);
}

TEST_F(Registry, TheSwitchKeepsWhatItIsNotGiven) {
    EXPECT_EQ(TARQUISetZEL(1, "A", nullptr), 0);
    EXPECT_EQ(Text(), "[PairedClientInfo]\nzelEnabled=\"yes\"\n");
    EXPECT_EQ(TARQUISetZEL(0, "A", "nas"), 0);
    EXPECT_EQ(TARQUISetZEL(2, nullptr, "other"), 0);
    EXPECT_EQ(Text(),
              "[PairedClientInfo]\nzelEnabled=\"yes\"\nclientID=\"A\"\nserverName=\"nas\"\n");
    for (const char* operation : {"KAPICSzHashAlloc", "KAPICFileGetSection", "KAPICSzHashSetValue",
                                  "KAPICSemOpen", "KAPICIFileModifySection"}) {
        Fail(operation);
        EXPECT_EQ(TARQUISetZEL(0, nullptr, nullptr), -1) << operation;
    }
    Fail("KAPICSzHashSetValue", 5);  // three are read, clientID, then serverName
    EXPECT_EQ(TARQUISetZEL(0, "B", "nas"), -1);
    EXPECT_THAT(Text(), HasSubstr("zelEnabled=\"yes\"\nclientID=\"A\""));
}

TEST_F(Registry, AShareIsSyncedWhileSomebodyRunsAndTheSwitchIsNotOff) {
    const std::string share = "[SHARE_a]|RunningID=A|";
    // clang-format off
    for (const auto& [text, synced] : std::vector<std::pair<std::string, int>>{
         {share, 1}, {"[PairedClientInfo]|" + share, 1},
         {"[PairedClientInfo]|zelEnabled=No|" + share, 1},
         {"[PairedClientInfo]|zelEnabled=no|" + share, 0}, {"[SHARE_a]|RunningID=|", 0},
         {"[SHARE_a]|", 0}, {"[SHARE_A]|RunningID=A|", 0}, {"", 0}}) {
        // clang-format on
        Write(text);
        EXPECT_EQ(TARQZELIsSyncedShare("a"), synced) << text;
    }
    EXPECT_EQ(TARQZELIsSyncedShare(""), 0);
    EXPECT_EQ(KAPICErrGet(), 0xD00);
    EXPECT_THAT(test::TakeSyslogTexts(), IsEmpty()) << "absence is no error";

    Write(share);
    for (int after : {0, 1}) {
        Fail("KAPICFileGetSectionValue", after);
        EXPECT_EQ(TARQZELIsSyncedShare("a"), 0);
    }
    Fail("KAPICStrGet");
    EXPECT_EQ(TARQZELIsSyncedShare("a"), 0);
    const std::string at = "ZEL/is_syncedshare:[0-9]+ ",
                      read = at + "KAPICFileGetSectionValue error. key:.";
    EXPECT_THAT(test::TakeSyslogTexts(),
                ElementsAre(MatchesRegex(read + "PairedClientInfo. errno=.0x0123."),
                            MatchesRegex(read + "SHARE_a. errno=.0x0123."),
                            MatchesRegex(at + "Fail to KAPICStrGet shareName:.a. errno=.0x0123.")));
}

TEST_F(Registry, AShareThatAnotherClientSyncsIntoIsRefused) {
    const std::string id = "123456789-123456789-123456789-123456";  // as long as identities go
    const std::string name = "12345678901234567890123456789012";    // as much of a name as counts
    Write(
        "[SHARE_Photos]|CompleteID=A|RunningID=B|[SHARE_music]|CompleteID=|RunningID=|[SHARE_half]|"
        "CompleteID=A|"
        "[SHARE_none]|[SHARE_MUSIC]|RunningID=|[SHARE_long]|CompleteID=|RunningID=" +
        id + "|[SHARE_Music]|RunningID=C|[SHARE_" + name + "X]|RunningID=B|");
    // clang-format off
    for (const auto& [shares, client, result] :
         std::vector<std::tuple<std::vector<std::string>, std::string, std::string>>{
         {{"new"}, "A", "0"}, {{"photos"}, "A", "214 photos"}, {{"photos", "Photos"}, "B", "0"},
         {{"new", "Photos", "video"}, "A", "214 Photos"}, {{"music"}, "A", "214 music"},
         {{"music"}, "C", "0"}, {{"Photos", "half", "music"}, "A", "206 Photos"},
         {{"none"}, "A", "206"}, {{"HALF"}, "A", "0"},
         {{"", "new", "", "photos"}, "A", "214   photos"}, {{"long"}, id, "0"},
         {{"long"}, id.substr(0, 35) + "7", "214 long"},
         {{name + "Y"}, "A", "214 " + name + "Y"}}) {
        // clang-format on
        EXPECT_EQ(Admit(shares, client.c_str()), result) << shares[0] << " for " << client;
    }
    const std::string error = "getSharePairStatus error",
                      parameter = "Parameter error on getSharePairStatus.";
    EXPECT_THAT(
        test::TakeSyslogTexts(),
        ElementsAre("Failed to get section [half] RunningID value.", error,
                    "Failed to get section [none] CompleteID value.", error, parameter, parameter));
}

TEST_F(Registry, AnAdmissionCheckThatCannotBeFinishedAdmitsNobody) {
    const std::string converted = "Failed to get converted shared name.",
                      memory = "Failed to allocate memory.\n";
    // clang-format off
    for (const auto& [operation, after, text, last] :
         std::vector<std::tuple<Str, int, std::string, std::string>>{
         {"KAPICFileGetSectionValue", 0, "Failed to get section [photos] CompleteID value.",
          "getSharePairStatus error"},
         {"KAPICSzListAlloc", 2, memory, converted}, {"KAPICSzHashAlloc", 0, memory, converted},
         {"KAPICFileEnumSection", 0, "Failed to get section list.\n", converted},
         {"KAPICFileGetSection", 0, "Failed to get section.\n", converted}}) {
        // clang-format on
        Write("[SHARE_PHOTOS]|");
        Fail(operation, after);
        EXPECT_EQ(Admit({"photos"}, "A"), "206") << operation;
        EXPECT_THAT(test::TakeSyslogTexts(), ElementsAre(text, last));
    }
    fs::remove_all(root_.Path("usr"));
    EXPECT_EQ(Admit({"photos"}, "A"), "206");
    EXPECT_THAT(test::TakeSyslogTexts(), ElementsAre("Failed to check server info.\n", converted));
    Write("[SHARE_PHOTOS]|RunningID=B|");
    Fail("KAPICSzListPush", 3);  // left over, photos and the section's name come first
    EXPECT_EQ(Admit({"photos"}, "A"), "206") << "a refusal that cannot be told";
    failing = "";
    EXPECT_EQ(Admit({"photos"}, ""), "201 left over");
    EXPECT_EQ(Admit({}, "A"), "201 left over");
    EXPECT_EQ(ZELCheckIfSharePaired(nullptr, "A", nullptr), 201);
    EXPECT_EQ(test::TakeSyslogTexts(),
              std::vector<std::string>(3, "Input parameters are null or empty!"));
}

TEST_F(Registry, AnOldClientIsOneThatOwnsThePairing) {
    const std::string marker = "ZELMULTI-SRC-SUPPORT";
    // clang-format off
    for (const auto& [client, server, paired] :
         std::vector<std::tuple<std::string, std::string, int>>{
         {"A", "nas", 1}, {"A", marker, 1}, {marker, "nas", 1}, {marker, marker, 0}, {"", "nas", 0},
         {"A", "", 0}}) {
        // clang-format on
        Write(std::string("[PairedClientInfo]|clientID=").append(client).append("|serverName=") +
              server);
        EXPECT_EQ(ZELServerIfOldClientPaired(), paired) << client << " " << server;
    }
    Write("");
    EXPECT_EQ(ZELServerIfOldClientPaired(), 0);
    for (const char* operation : {"KAPICSzHashAlloc", "KAPICFileGetSection"}) {
        Fail(operation);
        EXPECT_EQ(ZELServerIfOldClientPaired(), -1);
    }
    EXPECT_THAT(test::TakeSyslogTexts(),
                ElementsAre("Failed to allocate memory of hash.", "Get server paired-info error."));
}

TEST_F(Registry, APairingIsRecordedWhole) {
    Write("[PairedClientInfo]\nzelEnabled=\"no\"\n");
    const Hash pair{{"clientID", "A"}, {"serverName", "nas"}, {"other", "x"}};
    EXPECT_EQ(ZELServerSetPairValue(pair), 0);
    EXPECT_EQ(Text(),
              "[PairedClientInfo]\n\tclientID=\"A\"\n\tserverName=\"nas\"\n\tzelEnabled=\"no\"\n");
    EXPECT_EQ(ZELServerUpdatePairInfo("B", "box"), 0);
    const std::string multi =
        "[PairedClientInfo]\n\tclientID=\"ZELMULTI-SRC-SUPPORT\"\n"
        "\tserverName=\"ZELMULTI-SRC-SUPPORT\"\n\tzelEnabled=\"no\"\n";
    EXPECT_EQ(Text(), multi + "[CLIENTID_B]\n\tServerName=\"box\"\n");

    Write("");
    EXPECT_EQ(ZELServerSetPairValue(nullptr), 201);
    EXPECT_EQ(ZELServerSetPairValue(Hash{{"clientID", "A"}}), 202);
    EXPECT_EQ(ZELServerUpdatePairInfo("", "box"), 201);
    EXPECT_EQ(ZELServerUpdatePairInfo("B", nullptr), 201);
    for (const auto& [operation, pair_result, info_result] :
         {std::tuple("KAPICSzHashAlloc", 200, 200),
          {"KAPICFileGetSection", 206, 205},
          {"KAPICSzHashSetValue", 202, 202},
          {"KAPICSemOpen", 205, 205}}) {
        Fail(operation);
        EXPECT_EQ(ZELServerSetPairValue(pair), pair_result) << operation;
        Fail(operation);
        EXPECT_EQ(ZELServerUpdatePairInfo("B", "box"), info_result) << operation;
    }
    EXPECT_EQ(Text(), "");
}

TEST_F(Registry, TheStatusTellsWhatIsServedAndWhetherASyncRuns) {
    EXPECT_EQ(Status(), "0:00 - -");
    const std::string on = "[PairedClientInfo]|zelEnabled=yes|clientID=A|";
    Write(on);
    EXPECT_EQ(Status(), "0:00 A -") << "no rsync daemon";
    root_.Write("var/run/rsyncd.pid", std::to_string(getpid()) + "\n");
    EXPECT_EQ(Status(), "0:10 A -");
    const auto ago = [](long long seconds) { return std::to_string(time(nullptr) - seconds); };
    // clang-format off
    for (const auto& [tasks, busy] : std::vector<std::pair<std::string, char>>{
         {"[TASK_1]|status=idle|[TASK_]|status=" + ago(0), '1'},
         {"[TASK_1]|status=" + ago(110), '1'}, {"[TASK_1]|status=" + ago(120), '0'},
         {"[TASK_1]|status=" + ago(-500), '1'}, {"[TASK_1]|status=abc", '0'},
         {"[TASKX]|status=" + ago(0), '0'}, {"[TASK_1]|other=" + ago(0), '0'},
         {"[TASK_1]|status=" + ago(-(1LL << 32)), '1'},
         {"[TASK_1]|status=-99999999999999999999", '0'}}) {
        // clang-format on
        Write(on + tasks);
        EXPECT_EQ(Status(), std::string("0:1") + busy + " A -") << tasks;
    }
    Write(on + "[TASK_1]|status=idle|[TASK_2]|status=" + ago(0));
    for (const auto& [operation, after, expected] :
         {std::tuple("KAPICFileGetSection", 0, "-1:00 - -"),
          {"KAPICFileGetSection", 1, "-1:10 - -"},
          {"KAPICFileGetSection", 2, "0:10 A -"},
          {"KAPICFileEnumSection", 0, "0:10 A -"},
          {"KAPICSzListAlloc", 0, "0:10 A -"}}) {
        Fail(operation, after);
        EXPECT_EQ(Status(), expected) << operation << after;
    }
    EXPECT_EQ(zel_svr_put_status(nullptr), 0);
    EXPECT_EQ(zel_svr_get_status(nullptr), -1);
}

TEST_F(Registry, AResetGivesTheSingleClientItsOwnSection) {
    Write("[PairedClientInfo]\n\tzelEnabled=\"yes\"\n\tclientID=\"A\"\n\tserverName=\"nas\"\n");
    EXPECT_EQ(zel_svr_reset_pair(), 0);
    const std::string multi =
        "[PairedClientInfo]\n\tzelEnabled=\"yes\"\n\tclientID=\"ZELMULTI-SRC-SUPPORT\"\n"
        "\tserverName=\"ZELMULTI-SRC-SUPPORT\"\n[CLIENTID_A]\nServerName=\"nas\"\n";
    EXPECT_EQ(Text(), multi);
    EXPECT_EQ(zel_svr_reset_pair(), 0);
    EXPECT_EQ(Text(),
              multi + "[CLIENTID_ZELMULTI-SRC-SUPPORT]\nServerName=\"ZELMULTI-SRC-SUPPORT\"\n");

    for (const auto& [text, message] :
         {std::pair("clientID=\"A\"\n", "Failed to get serverName from hash."),
          {"serverName=\"n\"\n", "Failed to get clientID from hash."}}) {
        Write(std::string("[PairedClientInfo]\n") + text);
        EXPECT_EQ(zel_svr_reset_pair(), 0);
        EXPECT_THAT(test::TakeSyslogTexts(), ElementsAre(message));
        EXPECT_EQ(ZELServerIfOldClientPaired(), 0);
        EXPECT_THAT(Text(), HasSubstr("clientID=\"ZELMULTI-SRC-SUPPORT\""));
    }
    Write("[PairedClientInfo]\nclientID=\"A\"\nserverName=\"nas\"\n");
    Fail("KAPICFileAddSection");
    EXPECT_EQ(zel_svr_reset_pair(), 0);
    EXPECT_THAT(test::TakeSyslogTexts(), ElementsAre("Failed to add section [CLIENTID_A]."));
    for (const char* operation :
         {"KAPICSemOpen", "KAPICIFileModifySection", "KAPICFileGetSection"}) {
        Fail(operation);
        EXPECT_EQ(zel_svr_reset_pair(), -1) << operation;
    }
}

}  // namespace
