#include "ZEL/zel.h"

#include <pthread.h>

#include "tarq/core.h"
#include "tarq/netsdk.h"
#include "tarq/sdk.h"
#include "tarq/share.h"
#include "tarq/systemd.h"
#include "tests/support/log_capture.h"
#include "tests/support/testing.h"

namespace {

using Strings = std::vector<std::string>;
using namespace testing;

// What the platform's operations below answer with, and what they were asked.
struct Host {
    TARQShareRec share = {nullptr, const_cast<char*>("/volume1/docs"), 0, 256};
    std::string volume = "/volume1", serial;
    unsigned int volume_type = 1;
    int share_result = 0, encrypt_path_result = 0, volume_result = 0, open_records = 0;
    int small_device = 0, in_sharebin = 0, interfaces = 1;
    int unit_status = 0, unit_result = 0, unit_error = 0;
    bool look_up_fails = false;
    Strings addresses, calls;
} host;

int AskUnit(const char* unit, int result) {
    KAPICErrSetEx(host.unit_error, __FILE__, __LINE__);
    return std::string(unit) == "zel_daemon" ? result : -99;
}

}  // namespace

int TARQShareGet(const char* name, TARQShare* share) {
    host.calls.push_back(name);
    *share = new TARQShareRec(host.share);
    ++host.open_records;
    return host.share_result;
}
void TARQShareFree(TARQShare share) {
    host.open_records -= share != nullptr;
    delete share;
}
int KAPIShareEncryptPathGet(const char* path, char* buffer, int size) {
    snprintf(buffer, static_cast<size_t>(size), "%s/@%d@", path, size);
    return host.encrypt_path_result;
}
int VolumePathParseEx(const char* path, TARQVolumePath* volume) {
    host.calls.push_back(path);
    host.volume.copy(volume->path, sizeof volume->path);
    volume->type = host.volume_type;
    return host.volume_result;
}
int KAPICIsMiniUnit(void) {
    return host.small_device;
}
int TARQShareIsInSharebin(const char*) {
    return host.in_sharebin;
}
int KAPIGetSerialNumber(char* buffer, int size) {
    host.serial.copy(buffer, static_cast<size_t>(size));
    return 0;
}
int KAPINetGetInterfaceInfo(KAPINetInterface* records, int count, int flags) {
    *records = {"eth0", {0x02, 0x00, 0x5E, 0xAB, 0x0C, 0xFF}};
    return count == 1 && flags == 1 ? host.interfaces : -1;
}
int TARQNetLookupIP(const char* name, TARQNetAddress* records, int count, int) {
    host.calls.push_back(name + std::to_string(count));
    for (size_t i = 0; i < host.addresses.size(); ++i) {
        host.addresses[i].copy(records[i].address, sizeof records[i].address);
    }
    return host.look_up_fails ? -1 : static_cast<int>(host.addresses.size());
}
int TARQSystemdActiveStatusGet(const char* unit) {
    return AskUnit(unit, host.unit_status);
}
int TARQSystemdStart(const char* unit) {
    return AskUnit(unit, host.unit_result);
}
int TARQSystemdStop(const char* unit) {
    return AskUnit(unit, host.unit_result);
}

namespace {

class Zel : public testing::Test {
protected:
    Zel() { host = {}; }
    ~Zel() override { EXPECT_EQ(host.open_records, 0); }

    // Lets the machine answer NetBIOS queries.
    void Answer(const std::string& text) const {
        const std::string tool =
            root_.Write("usr/local/bin/nmblookup", "#!/bin/sh\necho \"$@\" >\"$0.asked\"\n" + text);
        chmod(tool.c_str(), 0700);
    }

    const test::TempRoot root_;
    const std::string asked_ = root_.Path("usr/local/bin/nmblookup.asked");
    const test::LogCapture quiet_{0};
};

TEST_F(Zel, AnEncryptedShareIsServedFromItsStorage) {
    ZEL::ShareInfo share;
    const auto module_of = [&](unsigned int flags) {
        host.share.flags = flags;
        EXPECT_EQ(ZEL::GetShareInfo("docs", share), 0);
        return share.GetModuleName() + " " + share.GetModulePath();
    };
    EXPECT_EQ(module_of(0x2), "@docs@ /volume1/docs/@4095@");
    EXPECT_EQ(module_of(~0x8886U), "docs /volume1/docs");
    EXPECT_FALSE(share.IsEncrypted() || share.IsAutoMount() || share.IsACL() || share.IsCluster());
    module_of(0x8084);
    EXPECT_TRUE(share.IsACL() && share.IsAutoMount() && share.IsCluster() && !share.IsWinShare());
}

TEST_F(Zel, AShareThatCannotBeLookedUpIsNeitherValidNorInvalid) {
    const std::function<void()> faults[] = {
        [] { host.share_result = -1; },
        [] { host.share.path = nullptr; },
        [] { host.encrypt_path_result = -1; },
        [] { host.volume_result = -1; },
    };
    bool valid = true;
    for (const auto& fault : faults) {
        host.share.flags = 0x2;
        fault();
        EXPECT_EQ(ZEL::IsValidShare("docs", valid), -1);
        EXPECT_EQ(host.open_records, 0);
        host = {};
    }
    EXPECT_EQ(ZEL::IsValidShare(std::string("docs\0x", 6), valid), -1);
    EXPECT_EQ(ZEL::IsValidShare("", valid), -1);
    EXPECT_THAT(host.calls, IsEmpty());
    EXPECT_TRUE(valid) << "touched";
}

TEST_F(Zel, SharesOnInternalVolumesAreValid) {
    const auto is_valid = [] {
        bool valid = false;
        EXPECT_EQ(ZEL::IsValidShare("docs", valid), 0);
        return valid;
    };
    host.share.flags = 0x2;
    host.volume = "/" + std::string(127, 'v');  // fills its field
    EXPECT_TRUE(is_valid());
    EXPECT_THAT(host.calls, ElementsAre("docs", "/volume1/docs"));
    host.volume_type = 0x80000001U;
    EXPECT_FALSE(is_valid());
    ZEL::VolumeInfo volume;
    ASSERT_EQ(ZEL::GetVolumeInfo("docs", volume), 0);
    EXPECT_EQ("/" + volume.GetName(), host.volume);
    host.calls.clear();
    host.small_device = 1;
    for (const int answer : {1, 0, 2, -1}) {
        host.in_sharebin = answer;
        EXPECT_EQ(is_valid(), answer == 1);
    }
    EXPECT_THAT(host.calls, IsEmpty());
}

TEST_F(Zel, ClientIsTheSerialNumberElseAMacAddress) {
    EXPECT_EQ(ZEL::GetClientID(), "02:00:5e:ab:0c:ff");
    host.interfaces = 0;
    EXPECT_EQ(ZEL::GetClientID(), "");
    host.serial = std::string(40, 's');
    EXPECT_EQ(ZEL::GetClientID(), std::string(36, 's'));
    root_.Write("usr/tarq/etc/tarqha.conf", "[pair]\nrunning=\"yes\"\n");
    EXPECT_EQ(ZEL::GetClientID(), host.serial);
    host.serial = "";
    EXPECT_EQ(ZEL::GetClientID(), "");
    root_.Write("usr/tarq/etc/tarqha.conf",
                "[pair]\nrunning=\"yes\"\nmac0=\"02:00:5e:00:00:01\"\n");
    EXPECT_EQ(ZEL::GetClientID(), "02:00:5e:00:00:01");
}

TEST_F(Zel, HostNameKeepsItsTail) {
    const auto tail = [&](const std::string& name, unsigned int skip) {
        root_.Write("usr/tarq/etc/tarqsdk.conf", "[device]\nhostname=\"" + name + "\"\n");
        return ZEL::GetHostName(skip);
    };
    EXPECT_EQ(tail(std::string(35, 'n'), 35), std::string(35, 'n'));
    EXPECT_EQ(tail(std::string(35, 'n') + "tail", 35), "tail");
    EXPECT_EQ(tail("na\ts", 0), "");
}

TEST_F(Zel, UsableAddresses) {
    const std::string literal(46, 'f');  // fills its field
    const Strings all = {literal, "10.0.0.8"};
    const std::string other = "echo SERVER1; printf '\\t\\n\\tOTHER#\\n\\tSERVER1\\n'";
    struct {
        const char *name, *address;
        std::string answer;
        Strings found, usable;
    } const cases[] = {
        {"", "10.0.0.5", "", all, {"10.0.0.5"}},
        {"", "", "", {}, {""}},
        {"server1", "", "", all, all},
        {"server1", "10.0.0.5", "yes '\tSERVER1 <00>'", all, {"10.0.0.5"}},  // without an end
        {"server1", "10.0.0.5", other, all, all},
        {"server1", "10.0.0.5", "printf '%0127d\\tSERVER1 <00>\\n' 0", all, all},
        {"longer_than_16_byte", "10.0.0.5", "printf '\\tLONGER_THAN_16_BYTE'", all, all},
        {"server1", "10.0.0.5", "", {}, {"10.0.0.5"}},
        {"server1", "FE80::1", "", {"10.0.0.7", "fe80::1"}, {"FE80::1"}},
    };
    for (const auto& c : cases) {
        Answer(c.answer);
        host.addresses = c.found;
        Strings out = {"before"};
        EXPECT_EQ(ZEL::GetUsableIP(c.name, c.address, out), 0);
        out.erase(out.begin());
        EXPECT_EQ(out, c.usable) << c.name << " " << c.address << " " << c.answer;
    }
    EXPECT_EQ(test::ReadFile(asked_), "-A FE80::1\n");
}

TEST_F(Zel, AnAddressIsNeverAnOptionAndAFailureAppendsNone) {
    Strings out;
    Answer("printf '\\tSERVER1'");
    EXPECT_EQ(ZEL::GetUsableIP("server1", "-option", out), 0);
    EXPECT_THAT(host.calls, ElementsAre("server120"));
    EXPECT_FALSE(fs::exists(asked_));
    out.clear();
    EXPECT_EQ(ZEL::GetUsableIP("server1", "", out), -1);
    host.look_up_fails = true;
    host.addresses = {"10.0.0.7"};
    EXPECT_EQ(ZEL::GetUsableIP("server1", "", out), -1);
    fs::remove(root_.Path("usr/local/bin/nmblookup"));
    EXPECT_EQ(ZEL::GetUsableIP("server1", "10.0.0.5", out), -1);
    EXPECT_THAT(out, IsEmpty());
}

TEST_F(Zel, StartingToleratesABusyUnitAndStoppingDoesNot) {
    for (const auto& [error, start, stop] : {std::tuple(0xEB00, 0, -1), {0xA00, -1, -1}}) {
        host.unit_error = error;
        EXPECT_EQ(ZEL::StartDaemon(), start);
        EXPECT_EQ(ZEL::StopDaemon(), stop);
    }
    host.unit_result = 1;
    EXPECT_EQ(ZEL::StartDaemon() + ZEL::StopDaemon(), 0);
    for (const int status : {1, 0, -1, 2}) {
        host.unit_status = status;
        EXPECT_EQ(ZEL::IsDaemonRunning(), status == 1);
    }
}

TEST_F(Zel, TempFilesAreNewEmptyAndPrivate) {
    const std::string path = ZEL::GetTempFile();
    ASSERT_EQ(path.rfind(root_.Path("tmp/ZEL/temp."), 0), 0U) << path;
    EXPECT_NE(ZEL::GetTempFile(), path);
    EXPECT_EQ(test::ModeOf(path), 0600U);
    EXPECT_EQ(fs::file_size(path), 0U);
    ZEL::PutTempFile(path);
    EXPECT_FALSE(fs::exists(path));
    // A folder in which somebody else can replace the file.
    fs::permissions(root_.Path("tmp/ZEL"), fs::perms::all);
    EXPECT_EQ(ZEL::GetTempFile(), "");
    fs::permissions(root_.Path("tmp/ZEL"), fs::perms::owner_all);
    if (chown(root_.Path("tmp/ZEL").c_str(), 65534, 65534) == 0) {
        EXPECT_EQ(ZEL::GetTempFile(), "");
    }
    fs::remove_all(root_.Path("tmp"));
    EXPECT_EQ(ZEL::GetTempFile(), "");
}

TEST_F(Zel, ALockIsHeldFromExLockToUnLockOrTheEnd) {
    const std::string path = root_.Path("lock");
    const ZEL::LockFactory factory(path);
    const auto is_free = [&] { return system(("flock -n '" + path + "' true").c_str()) == 0; };
    {
        ZEL::SimpleFileLock lock = factory.GetLock();
        EXPECT_EQ(test::ModeOf(path), 0600U);
        EXPECT_EQ(lock.ExLock() + lock.ExLock(), 0);
        EXPECT_FALSE(is_free());
        const std::string kept = "test -z \"$(find /proc/self/fd -lname '" + path + "')\"";
        EXPECT_EQ(system(kept.c_str()), 0) << "it stays out of programs";
        EXPECT_EQ(lock.UnLock(), 0);
        EXPECT_TRUE(is_free());
        EXPECT_EQ(lock.ExLock(), 0);
        ZEL::SimpleFileLock holder = std::move(lock);
        // NOLINTNEXTLINE(bugprone-use-after-move,clang-analyzer-cplusplus.Move): it is no lock now
        EXPECT_EQ(lock.ExLock(), -1);
        EXPECT_FALSE(is_free());
        holder = factory.GetLock();
        EXPECT_TRUE(is_free());
        EXPECT_EQ(holder.ExLock(), 0);
    }
    EXPECT_TRUE(is_free());
    EXPECT_EQ(ZEL::SimpleFileLock(root_.Path("missing/lock")).ExLock(), -1);
}

TEST_F(Zel, ALockWaitsThroughSignalsUntilItIsFree) {
    struct sigaction nothing = {};
    nothing.sa_handler = [](int) {};
    sigaction(SIGUSR1, &nothing, nullptr);
    const std::string path = root_.Write("lock", "kept");
    ZEL::SimpleFileLock held(path);
    ASSERT_EQ(held.ExLock(), 0);
    std::atomic<bool> given_back{false};
    std::thread waiter([&] {
        EXPECT_EQ(ZEL::SimpleFileLock(path).ExLock(), 0);
        EXPECT_TRUE(given_back);
    });
    for (int i = 0; i < 10; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
        pthread_kill(waiter.native_handle(), SIGUSR1);
    }
    given_back = true;
    EXPECT_EQ(held.UnLock(), 0);
    waiter.join();
    EXPECT_EQ(test::ReadFile(path), "kept");
}

}  // namespace
