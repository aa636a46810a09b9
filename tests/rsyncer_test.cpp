// The driver against a wrapper and a network that this program puts in front of the real ones;
// shares and host are the platform's own, configured below a root folder.
#include "ZEL/rsyncer.h"

#include "tarq/hacore.h"
#include "tarq/netsdk.h"
#include "tarq/sdk.h"
#include "tarq/share.h"
#include "tests/support/log_capture.h"
#include "tests/support/testing.h"

using namespace testing;

namespace {

// What the world outside the driver says, and what the driver has done to it.
struct World {
    struct Answer {
        int status = 0;
        std::string outfile = "";
    };
    std::map<std::string, std::vector<Answer>> answers;  // by command name; the last one stays
    int copy_status = 0;
    int addresses = 2;

    std::vector<std::vector<std::string>> commands;  // lines of each command sent
    std::vector<std::string> runs;                   // setter calls of each run, in order
    bool last_was_ended = false;                     // its canceller said so
    int errors_logged = 0;

    World::Answer Next(const std::string& command) {
        auto& list = answers[command];
        if (list.size() > 1) {
            const Answer answer = list.front();
            list.erase(list.begin());
            return answer;
        }
        return list.empty() ? Answer() : list.front();
    }
};
World* world = nullptr;

std::string ValueOf(const std::string& line) {
    const size_t start = line.find("=\"") + 2;
    return line.substr(start, line.size() - start - 1);
}

std::string Flag(const std::string& name, bool on) {
    return name + (on ? "=1" : "=0");
}

}  // namespace

// ---- The platform in front ----

namespace TARQ {
namespace Backup {

struct RsyncWrapper::Impl {
    std::string calls;
    std::vector<std::string> command;
    void Note(const std::string& call) { calls += (calls.empty() ? "" : " ") + call; }
};

RsyncWrapper::RsyncWrapper() : impl_(new Impl) {}
RsyncWrapper::~RsyncWrapper() = default;
#define NOTE(setter, text)      \
    void RsyncWrapper::setter { \
        impl_->Note(text);      \
    }
NOTE(setDelete(bool on), Flag("setDelete", on))
NOTE(setNumericIds(bool on), Flag("setNumericIds", on))
NOTE(setTarqPseudoRoot(bool on), Flag("setTarqPseudoRoot", on))
NOTE(setSsh(bool on), Flag("setSsh", on))
NOTE(setCompress(bool on), Flag("setCompress", on))
NOTE(setDeltaCopy(bool on), Flag("setDeltaCopy", on))
NOTE(setListOnly(bool on), Flag("setListOnly", on))
NOTE(setRelativePath(bool on), Flag("setRelativePath", on))
NOTE(setTarqAcl(bool on), Flag("setTarqAcl", on))
NOTE(setDebugLog(bool on), Flag("setDebugLog", on))
NOTE(setTarqAuth(bool on, bool both), Flag("auth", on&& both))
NOTE(setPort(int port), "port=" + std::to_string(port))
NOTE(setTimeout(int seconds), "timeout=" + std::to_string(seconds))
NOTE(setExcludeRule(const std::list<std::string>& rules),
     "excludes=" + std::to_string(rules.size()))
NOTE(setSrcPath(const std::string& path), "src=" + path)
NOTE(setDestPath(const std::string& user, const std::string& host, const std::string& password,
                 const std::string& module, const std::string& sub_path),
     "dest=" + user + ":" + password + "@" + host + "::" + module + "|" + sub_path)
void RsyncWrapper::setTarqCustCmdRule(const std::list<std::string>& lines) {
    impl_->command.assign(lines.begin(), lines.end());
}
int RsyncWrapper::execute(const std::function<bool()>& cancelled) {
    impl_->Note(cancelled ? "cancellable" : "plain");
    world->runs.push_back(impl_->calls);
    world->last_was_ended = cancelled && cancelled();
    if (impl_->command.empty()) {
        return world->copy_status;
    }
    world->commands.push_back(impl_->command);
    const World::Answer answer = world->Next(ValueOf(impl_->command[0]));
    for (const std::string& line : impl_->command) {
        if (line.compare(0, 9, "outfile=\"") == 0 && answer.outfile != "none") {
            std::ofstream(ValueOf(line)) << answer.outfile;
        } else if (line.compare(0, 9, "outfile=\"") == 0) {
            remove(ValueOf(line).c_str());
        }
    }
    return answer.status;
}
void RsyncWrapper::logError() {
    ++world->errors_logged;
}

}  // namespace Backup
}  // namespace TARQ

extern "C" {
int TARQShareEncAutoKeyFileGet(TARQShare, char*, int) {
    return -1;
}
int VolumePathParseEx(const char*, TARQVolumePath* volume) {
    strcpy(volume->path, "/volume1");
    volume->type = 1;
    return 0;
}
int KAPINetGetInterfaceInfo(KAPINetInterface*, int, int) {
    return 0;
}
int TARQNetLookupIP(const char*, TARQNetAddress* records, int, int) {
    for (int i = 0; i < world->addresses; ++i) {
        snprintf(records[i].address, sizeof records[i].address, "10.0.0.%d", i + 1);
    }
    return world->addresses;
}
}

namespace {

class RsyncerTest : public testing::Test {
protected:
    RsyncerTest() {
        world = &world_;
        world_.answers["ZEL_GetProtocolVer"] = {{0, "1\n"}};
        Share("vault.key", "encrypted");
        SetSerial("SN1");
        root_.Write("docs/sub/file", "x");
        root_.Write("vault.enc/file", "x");
        info_.SetUser("alice");
        info_.SetPassword("secret");
        info_.SetServerName("server");
        info_.SetSSHPort(2222);
    }
    ~RsyncerTest() override { world = nullptr; }

    void Connect() {
        ASSERT_EQ(rsyncer_.Initialize(info_), 0);
        world_.commands.clear();
        world_.runs.clear();
    }
    void SetSerial(const std::string& serial) const {
        root_.Write("usr/tarq/etc/tarqsdk.conf",
                    "[device]\nserial=\"" + serial + "\"\nhostname=\"nas\"\n");
    }
    /// The shares "docs", with ACLs, and "vault", with a key file and flags.
    void Share(const std::string& key_file, const std::string& vault_flags) const {
        const std::string vault = root_.Path("vault");
        root_.Write(kCatalogue, "[docs]\npath=\"" + root_.Path("docs") +
                                    "\"\nflags=\"acl\"\nkey_length=\"256\"\n[vault]\npath=\"" +
                                    vault + "\"\nflags=\"" + vault_flags + "\"\nencrypted_path=\"" +
                                    vault + ".enc\"\nkey_file=\"" + root_.Path(key_file) + "\"\n");
    }

    static constexpr char kCatalogue[] = "usr/tarq/etc/tarqshare.conf";
    test::TempRoot root_;
    World world_;
    const test::LogCapture quiet_{0};
    ZEL::SyncInfo info_;
    ZEL::Rsyncer rsyncer_;
    int status_ = -7;
};

constexpr char kDefaults[] = "setDelete=1 setNumericIds=1 auth=1 setTarqPseudoRoot=1 ";

TEST_F(RsyncerTest, InitializeProbesEachAddressUntilOneAnswersTheVersionCommand) {
    world_.answers["ZEL_Pairing"] = {{10}, {207}};
    EXPECT_EQ(rsyncer_.Initialize(info_), 0);
    EXPECT_EQ(rsyncer_.GetLatestIP(), "10.0.0.2");
    EXPECT_TRUE(rsyncer_.SupportMultiSource());
    // A probe changes nothing, is kept out of the debug log, and never asks for a port without ssh.
    ASSERT_EQ(world_.commands.size(), 3U);
    EXPECT_THAT(world_.commands[0], ElementsAre("command=\"ZEL_Pairing\"", "clientID=\"SN1\"",
                                                "dryRun=\"yes\"", "serverName=\"nas\""));
    EXPECT_EQ(world_.runs[0],
              std::string(kDefaults) +
                  "setSsh=0 setDebugLog=0 timeout=600 dest=alice:secret@10.0.0.1::| plain");
    EXPECT_THAT(world_.runs[2], HasSubstr("timeout=600 setListOnly=1"));
}

TEST_F(RsyncerTest, TestServerReportsTheLastVerdictAndKeepsTheRightAddress) {
    const World::Answer version = {0, "1"};
    const struct {
        const char* name;
        World::Answer pairing, version;
        int addresses, expected;
        const char* address;
    } cases[] = {
        {"no address answers", {30}, version, 2, 30, ""},
        {"the name is unknown", {0}, version, 0, 42, ""},
        {"an old server", {0}, {43}, 2, 0, "10.0.0.1"},
        {"another old server", {0}, {51}, 2, 0, "10.0.0.1"},
        // Answers, but tells no version: the last candidate stays, and its probe's status is the
        // result.
        {"no version", {0}, {12}, 2, 0, "10.0.0.2"},
        {"an empty version file", {0}, {0, ""}, 1, 0, "10.0.0.1"},
        {"no version file", {0}, {0, "none"}, 1, 0, "10.0.0.1"},
    };
    for (const auto& c : cases) {
        world_.answers = {{"ZEL_Pairing", {c.pairing}}, {"ZEL_GetProtocolVer", {c.version}}};
        world_.addresses = c.addresses;
        ZEL::Rsyncer rsyncer;
        EXPECT_EQ(rsyncer.Initialize(info_), c.expected) << c.name;
        EXPECT_EQ(rsyncer.GetLatestIP(), c.address) << c.name;
        EXPECT_FALSE(rsyncer.SupportMultiSource());
    }
}

TEST_F(RsyncerTest, WithoutAClientIdentityNothingIsSent) {
    SetSerial("");
    EXPECT_EQ(rsyncer_.Initialize(info_), 213);
    EXPECT_EQ(rsyncer_.SendBeacon("t", status_), -1);
    EXPECT_EQ(status_, -7);
    EXPECT_THAT(world_.commands, IsEmpty());
}

TEST_F(RsyncerTest, MultiPairingNamesTheSharesAndReadsTheConflicts) {
    Connect();
    world_.answers["ZEL_PairingMultiSrc"] = {{214, "a::b\nrest\n"}, {0, ""}, {212}, {0, "none"}};
    std::list<std::string> conflicts = {"before"};
    EXPECT_EQ(rsyncer_.DoPairing(true, {"docs", "vault", "unknown"}, conflicts, status_), 0);
    EXPECT_EQ(status_, 214);
    EXPECT_THAT(conflicts, ElementsAre("before", "a", "", "b"));
    // The scan ends at the first encrypted share: the unknown one behind it is no failure.
    ASSERT_EQ(world_.commands.size(), 1U);
    EXPECT_THAT(
        world_.commands[0],
        ElementsAre("command=\"ZEL_PairingMultiSrc\"", "clientID=\"SN1\"", "serverName=\"nas\"",
                    "syncShares=\"docs:vault:unknown\"", "dryRun=\"yes\"",
                    testing::StartsWith("outfile=\"" + root_.Path("tmp/ZEL/temp.")),
                    "requireEncryptionShareSupport=\"yes\""));

    EXPECT_EQ(rsyncer_.DoPairing(false, {"docs"}, conflicts, status_), 0);
    EXPECT_EQ(conflicts.size(), 4U);
    // Refused; accepted without an answer; a share that there is not; no share.
    using Shares = std::list<std::string>;
    for (const Shares& shares : {Shares{"docs"}, Shares{"docs"}, Shares{"unknown"}, Shares{}}) {
        EXPECT_EQ(rsyncer_.DoPairing(false, shares, conflicts, status_), -1);
    }
    EXPECT_TRUE(fs::is_empty(root_.Path("tmp/ZEL")));

    // An old server is not told the shares.
    world_.answers["ZEL_GetProtocolVer"] = {{43}};
    Connect();
    EXPECT_EQ(rsyncer_.DoPairing(false, {"docs"}, conflicts, status_), 0);
    EXPECT_THAT(conflicts, IsEmpty());
    EXPECT_THAT(world_.commands[0], ElementsAre("command=\"ZEL_Pairing\"", "clientID=\"SN1\"",
                                                "dryRun=\"no\"", "serverName=\"nas\""));
}

TEST_F(RsyncerTest, StartFallsBackToTheShortFormOnlyWhenTheServerAsksForIt) {
    Connect();
    world_.answers["ZEL_SyncStart"] = {{202}, {0}};
    EXPECT_EQ(rsyncer_.StartSyncShare("docs", status_), 0);
    EXPECT_EQ(status_, 0);
    ASSERT_EQ(world_.commands.size(), 2U);
    EXPECT_THAT(world_.commands[0],
                ElementsAre("command=\"ZEL_SyncStart\"", "clientID=\"SN1\"",
                            "volumeName=\"volume1\"", "shareName=\"docs\"", "isEncrypt=\"0\"",
                            "isAutomount=\"0\"", "isEnableACL=\"1\"", "isWinShare=\"0\"",
                            "lenEncKey=\"256\"", "connAccount=\"alice\""));
    EXPECT_EQ(world_.commands[1].size(), 4U);
    world_.answers["ZEL_SyncStart"] = {{214}};
    EXPECT_EQ(rsyncer_.StartSyncShare("docs", status_), 0);
    EXPECT_EQ(status_, 214);
    EXPECT_EQ(world_.commands.size(), 3U);
    EXPECT_EQ(rsyncer_.StartSyncShare("unknown", status_), -1);
}

TEST_F(RsyncerTest, ADataRunGoesIntoTheSharesModule) {
    info_.SetSSH(true);
    info_.SetCompression(true);
    rsyncer_.SetCancelChecker([] { return false; });
    Connect();
    EXPECT_EQ(rsyncer_.RunSync(1, "docs", "/", {"*.tmp"}, status_), 0);
    EXPECT_EQ(status_, 0);
    const std::string base =
        std::string(kDefaults) +
        "setSsh=1 setDebugLog=1 port=2222 timeout=600 setCompress=1 setDeltaCopy=0 setTarqAcl=1 ";
    const std::string docs = root_.Path("docs");
    EXPECT_EQ(world_.runs[0],
              base + "excludes=1 src=" + docs + "/ dest=alice:secret@10.0.0.1::docs| cancellable");
    EXPECT_EQ(rsyncer_.RunSync(1, "docs", "/sub", {}, status_), 0);
    EXPECT_EQ(world_.runs[1], base + "setRelativePath=1 excludes=0 src=" + docs +
                                  "/./sub dest=alice:secret@10.0.0.1::docs| cancellable");
    EXPECT_EQ(rsyncer_.RunSync(1, "vault", "/", {}, status_), 0);
    EXPECT_THAT(world_.runs[2], HasSubstr("src=" + root_.Path("vault.enc") +
                                          "/ dest=alice:secret@10.0.0.1::@vault@|"));
    // The host is asked once for each share. Statuses come back as they are, and any but 0 is
    // explained, 207 too.
    fs::remove(root_.Path(kCatalogue));
    world_.copy_status = 207;
    EXPECT_EQ(rsyncer_.RunSync(1, "docs", "/", {}, status_), 0);
    EXPECT_EQ(status_, 207);
    EXPECT_EQ(world_.errors_logged, 1);
    // A path that is gone is no error and no run.
    EXPECT_EQ(rsyncer_.RunSync(1, "docs", "/gone", {}, status_), 0);
    EXPECT_EQ(status_, 0);
    EXPECT_EQ(world_.runs.size(), 4U);
}

TEST_F(RsyncerTest, EveryTaskIsSetUpAndACancellerIsAskedWhereThereIsNoChecker) {
    bool enough = false;
    rsyncer_.SetTaskSetup([&](ZEL::Rsyncer::RsyncTask& task) {
        task.setDelete(false);
        task.SetCanceller([&] { return enough; });
    });
    Connect();
    EXPECT_FALSE(world_.last_was_ended);
    enough = true;
    EXPECT_EQ(rsyncer_.SendBeacon("task", status_), 0);
    EXPECT_TRUE(world_.last_was_ended);
    EXPECT_EQ(rsyncer_.RunSync(1, "docs", "/", {}, status_), 0);
    EXPECT_TRUE(world_.last_was_ended);
    EXPECT_THAT(world_.runs, Each(HasSubstr("timeout=600 setDelete=0 ")));
    rsyncer_.SetCancelChecker([] { return false; });
    EXPECT_EQ(rsyncer_.RunSync(1, "docs", "/", {}, status_), 0);
    EXPECT_FALSE(world_.last_was_ended);
}

TEST_F(RsyncerTest, CommandsThatAreAcceptedAreNotExplained) {
    Connect();
    for (const int status : {0, 207, 208, 214}) {
        world_.answers["ZEL_UpdateTaskStatus"] = {{status}};
        EXPECT_EQ(rsyncer_.SendBeacon("task", status_), 0);
        EXPECT_EQ(status_, status);
    }
    EXPECT_EQ(world_.errors_logged, 1);
    EXPECT_EQ(rsyncer_.FinishSync("share", "docs", status_), 0);
    EXPECT_THAT(world_.commands.back(),
                ElementsAre("command=\"ZEL_SyncFinish\"", "clientID=\"SN1\"",
                            "finishType=\"share\"", "name=\"docs\""));
    EXPECT_EQ(rsyncer_.FinishSync("", "docs", status_), -1);
    EXPECT_EQ(rsyncer_.SendBeacon("", status_), -1);
}

TEST_F(RsyncerTest, AKeyFileTravelsOverSshWhateverTheTaskSays) {
    Connect();
    root_.Write("usr/tarq/etc/.encrypt/@docs", "a key that nothing is encrypted with");
    EXPECT_EQ(rsyncer_.SyncEncryptKey("docs"), 0);
    EXPECT_EQ(rsyncer_.SyncEncryptKey("vault"), 0);
    EXPECT_THAT(world_.runs, IsEmpty());

    const std::string key = root_.Write("vault.key", "key");
    world_.copy_status = 12;
    EXPECT_EQ(rsyncer_.SyncEncryptKey("vault"), 12);
    EXPECT_EQ(world_.runs[0],
              std::string(kDefaults) +
                  "setSsh=0 setDebugLog=1 timeout=600 setCompress=0 setDeltaCopy=0 setSsh=1 "
                  "port=2222 excludes=0 src=" +
                  key + " dest=alice:secret@10.0.0.1::/usr/tarq/etc/.encrypt|vault plain");

    Share("vault.key", "encrypted auto_mount");
    EXPECT_EQ(rsyncer_.SyncEncryptKey("vault"), 300);
    EXPECT_EQ(rsyncer_.SyncEncryptKey("unknown"), 300);
}

}  // namespace
