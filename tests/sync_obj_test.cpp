#include "ZEL/sync_obj.h"

#include "tarq/core.h"
#include "tarq/share.h"
#include "tests/support/log_capture.h"
#include "tests/support/testing.h"

namespace {

std::vector<std::string> asked_shares;

}  // namespace

// A host of the small family, where the share's name alone decides: those that begin with "ok" are
// valid.
int KAPICIsMiniUnit(void) {
    return 1;
}

int TARQShareIsInSharebin(const char* name) {
    asked_shares.emplace_back(name);
    return asked_shares.back().rfind("ok", 0) == 0 ? 1 : 0;
}

namespace {

using namespace testing;
using ZEL::SyncInfo;
using ZEL::TaskInfo;

SyncInfo ValidInfo(uint32_t port = 0, uint32_t timeout = 600) {
    SyncInfo info;
    info.SetServerName("server");
    info.SetUser("user");
    info.SetSSHPort(port);
    info.SetRsyncTimeout(timeout);
    return info;
}

TEST(SyncInfo, SwitchesTouchTheirOwnBitAlone) {
    SyncInfo info;
    info.SetSyncConfigFlag(0x11);
    info.SetSSH(true);
    EXPECT_EQ(info.GetSyncConfigFlag(), 0x13U);
    info.SetCompression(false);
    EXPECT_EQ(info.GetSyncConfigFlag(), 0x12U);
    EXPECT_TRUE(info.UseSSH() && !info.UseCompression() && !info.UseBlockLevelSync());
    info.SetBlockLevelSync(true);
    EXPECT_EQ(info.GetSyncConfigFlag(), 0x16U);
}

TEST(SyncInfo, ValidateLogsTheFirstFault) {
    SyncInfo address_only;
    address_only.SetServerIP("10.0.0.5");
    const std::pair<SyncInfo, const char*> cases[] = {
        {SyncInfo(), "[NOTE] ZEL/sync_obj(N): Empty server ip and name\n"},
        {address_only, "[NOTE] ZEL/sync_obj(N): Empty user name\n"},
        {ValidInfo(65535, 600), ""},
        {ValidInfo(65536, 599), "[NOTE] ZEL/sync_obj(N): Invalid SSH port '65536'\n"},
        {ValidInfo(0, 599), "[ERROR] ZEL/sync_obj(N): Invalid rsync timeout '599'\n"},
        {ValidInfo(0, 86400), ""},
        {ValidInfo(0, UINT32_MAX), "[ERROR] ZEL/sync_obj(N): Invalid rsync timeout '4294967295'\n"},
    };
    for (const auto& [info, line] : cases) {
        const test::LogCapture log;
        EXPECT_EQ(info.Validate(), *line == '\0');
        EXPECT_EQ(log.Text(), line);
    }
}

TEST(TaskInfo, ValidateLogsTheFirstFaultAndAsksNoFurther) {
    TaskInfo task;
    const auto fault = [&] {
        asked_shares.clear();
        const test::LogCapture log;
        const bool valid = task.Validate();
        EXPECT_EQ(valid, log.Text().empty());
        return log.Text();
    };
    EXPECT_EQ(fault(), "[NOTE] ZEL/sync_obj(N): Empty server ip and name\n");
    task.SetSyncInfo(ValidInfo());
    task.GetSchedule().SetStartHour(24);
    EXPECT_EQ(fault(), "[NOTE] ZEL/sync_obj(N): Invalid begin hour\n");
    task.GetSchedule().SetStartHour(23);
    EXPECT_EQ(fault(), "[NOTE] ZEL/sync_obj(N): Empty task name");
    task.SetName("nightly");
    EXPECT_EQ(fault(), "[NOTE] ZEL/sync_obj(N): Empty share list");
    task.SetShareList({"ok 1", "usb", "ok 2"});
    EXPECT_EQ(fault(), "[NOTE] ZEL/sync_obj(N): Share 'usb' is not valid\n");
    EXPECT_THAT(asked_shares, ElementsAre("ok 1", "usb"));
    task.SetShareList({"ok 1", "ok 2"});
    EXPECT_EQ(fault(), "");
}

TEST(Event, RelativePathBeginsWithASlashOnceSet) {
    ZEL::Event event;
    EXPECT_EQ(event.GetRelativePath(), "");
    const std::pair<const char*, const char*> cases[] = {
        {"a/b", "/a/b"}, {"/a/b", "/a/b"}, {"", "/"}, {"//x/", "//x/"}, {"../x", "/../x"}};
    for (const auto& [given, kept] : cases) {
        event.SetRelativePath(given);
        EXPECT_EQ(event.GetRelativePath(), kept);
    }
}

}  // namespace
