#include "ZEL/is_syncedshare.h"

#include <dlfcn.h>
#include <syslog.h>

#include "tests/support/string_hash.h"
#include "tests/support/syslog_capture.h"
#include "tests/support/testing.h"

namespace {

std::string failing;  // the platform operation that fails
int passes = 0;       // how many calls of it succeed first

bool Fails(const char* operation) {
    if (failing != operation || passes-- > 0) {
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
    static void Fail(const std::string& operation, int after = 0) {
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
    EXPECT_FALSE(fs::exists(path_)) << "bad arguments touch nothing";
    EXPECT_EQ(ZELServerGetShare("a", "k", buffer, 8), -1);
    EXPECT_TRUE(fs::exists(path_));

    fs::remove_all(root_.Path("usr"));
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

TEST_F(Registry, AFailureOfThePlatformIsAnsweredAndLosesNeitherTextNorLock) {
    const std::string old =
        "[PairedClientInfo]\nzelEnabled=\"yes\"\nclientID=\"A\"\nserverName=\"nas\"\n"
        "[SHARE_PHOTOS]\nCompleteID=\"\"\nRunningID=\"B\"\n"
        "[TASK_1]\nstatus=\"idle\"\n[TASK_2]\nstatus=\"" +
        std::to_string(time(nullptr)) + "\"\n";
    const Hash values{{"clientID", "B"}, {"serverName", "box"}};
    const auto update = [&] { return std::to_string(ZELServerUpdateShare("PHOTOS", values)); };
    const auto append = [&] { return std::to_string(ZELServerUpdateShare("new", values)); };
    const auto turn_off = [] { return std::to_string(TARQUISetZEL(0, nullptr, nullptr)); };
    const auto rename = [] { return std::to_string(TARQUISetZEL(0, "B", "box")); };
    const auto is_synced = [] { return std::to_string(TARQZELIsSyncedShare("PHOTOS")); };
    const auto set_pair = [&] { return std::to_string(ZELServerSetPairValue(values)); };
    const auto update_pair = [] { return std::to_string(ZELServerUpdatePairInfo("B", "box")); };
    const auto old_client = [] { return std::to_string(ZELServerIfOldClientPaired()); };
    const auto reset = [] { return std::to_string(zel_svr_reset_pair()); };
    const auto admit = [] { return Admit({"photos"}, "A"); };
    // An operation, and how often it succeeds before: once for each section that is read first, and
    // for each list that Admit() makes itself.
    const struct {
        std::function<std::string()> call;
        std::string answer;
        const char* faults;
    } cases[] = {
        {update, "-1", "SemOpen SemLock SzHashAlloc FileGetSection FileSetSection"},
        {append, "-1", "FileAddSection"},
        {turn_off, "-1", "SzHashAlloc FileGetSection SzHashSetValue SemOpen IFileModifySection"},
        {rename, "-1", "SzHashSetValue+5"},
        {is_synced, "0", "FileGetSectionValue FileGetSectionValue+1 StrGet"},
        {old_client, "-1", "SzHashAlloc FileGetSection"},
        {set_pair, "200", "SzHashAlloc"},
        {set_pair, "206", "FileGetSection"},
        {set_pair, "202", "SzHashSetValue+3"},
        {set_pair, "205", "SemOpen"},
        {update_pair, "200", "SzHashAlloc"},
        {update_pair, "205", "FileGetSection SemOpen"},
        {update_pair, "202", "SzHashSetValue"},
        {reset, "-1", "SemOpen IFileModifySection FileGetSection"},
        {admit, "206", "FileGetSectionValue SzListAlloc+2 SzHashAlloc FileEnumSection"},
        {admit, "206", "FileGetSection SzListPush+3"},
        {Status, "-1:00 - -", "FileGetSection"},
        {Status, "-1:10 - -", "FileGetSection+1"},
        {Status, "0:10 A nas", "FileGetSection+2 FileEnumSection SzListAlloc"},
    };
    root_.Write("var/run/rsyncd.pid", std::to_string(getpid()) + "\n");
    for (const auto& c : cases) {
        std::istringstream faults(c.faults);
        for (std::string fault; faults >> fault;) {
            const size_t end = std::min(fault.find('+'), fault.size());
            Write(old);
            Fail("KAPIC" + fault.substr(0, end), atoi(fault.c_str() + end));
            EXPECT_EQ(c.call(), c.answer) << fault;
            EXPECT_THAT(Text(), StartsWith(old)) << fault;
            failing = "";
            EXPECT_EQ(ZELServerUpdateTask("1", values), 0) << "the lock was given back";
        }
    }
}

TEST_F(Registry, AFileThatCannotBeReachedIsLogged) {
    fs::remove_all(root_.Path("usr"));
    root_.Write("usr", "in the way");
    EXPECT_EQ(ZELUpdateServerInfo("", Hash{}), -1);
    const auto log = test::TakeSyslog();
    ASSERT_EQ(log.size(), 2U);
    EXPECT_EQ(log[0].text, "Failed to stat file [" + path_ + "], errno=[20/Not a directory]");
    EXPECT_EQ(log[0].priority, LOG_ERR);
}

TEST_F(Registry, TheSwitchKeepsWhatItIsNotGiven) {
    EXPECT_EQ(TARQUISetZEL(1, "A", nullptr), 0);
    EXPECT_EQ(Text(), "[PairedClientInfo]\nzelEnabled=\"yes\"\n");
    EXPECT_EQ(TARQUISetZEL(0, "A", "nas"), 0);
    EXPECT_EQ(TARQUISetZEL(2, nullptr, "other"), 0);
    EXPECT_EQ(Text(),
              "[PairedClientInfo]\nzelEnabled=\"yes\"\nclientID=\"A\"\nserverName=\"nas\"\n");
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
    EXPECT_EQ(Admit({"photos"}, ""), "201 left over");
    EXPECT_EQ(Admit({}, "A"), "201 left over");
    EXPECT_EQ(ZELCheckIfSharePaired(nullptr, "A", nullptr), 201);
    fs::remove_all(root_.Path("usr"));
    EXPECT_EQ(Admit({"photos"}, "A"), "206");
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

    for (const char* text : {"clientID=\"A\"\n", "serverName=\"n\"\n"}) {
        Write(std::string("[PairedClientInfo]\n") + text);
        EXPECT_EQ(zel_svr_reset_pair(), 0);
        EXPECT_EQ(ZELServerIfOldClientPaired(), 0);
        EXPECT_THAT(Text(), HasSubstr("clientID=\"ZELMULTI-SRC-SUPPORT\""));
    }
    Write("[PairedClientInfo]\nclientID=\"A\"\nserverName=\"nas\"\n");
    Fail("KAPICFileAddSection");
    EXPECT_EQ(zel_svr_reset_pair(), 0) << "the pairing itself was reset";
}

}  // namespace
