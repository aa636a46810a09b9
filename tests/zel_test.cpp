#include "ZEL/zel.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <stdarg.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <stdexcept>
#include <thread>

#include "tarq/core.h"
#include "tarq/hacore.h"
#include "tarq/netsdk.h"
#include "tarq/sdk.h"
#include "tarq/share.h"
#include "tarq/systemd.h"
#include "tests/support/log_capture.h"

namespace {

using Strings = std::vector<std::string>;
using testing::ElementsAre;
using testing::IsEmpty;

// What the platform's operations below answer with, and what they were asked.
struct Host {
    bool has_share = true;
    const char* share_path = "/volume1/docs";
    unsigned int share_flags = 0;
    int encrypt_path_result = 0;
    int volume_result = 0;
    std::string volume_path = "/volume1";
    unsigned int volume_type = 1;
    bool small_device = false;
    int in_sharebin = 1;
    int open_records = 0;

    bool pair = false;
    std::string serial;
    std::string pair_mac;
    int interfaces = 1;
    int host_name_result = 0;
    std::string host_name;
    int lookup_result = 0;
    Strings addresses;
    std::string netbios_answer;
    bool netbios_starts = true;
    int open_programs = 0;

    int unit_status = 0;
    int unit_result = 0;
    int error = 0;

    Strings calls;
} host;

void Fill(char* buffer, int size, const std::string& text) {
    text.copy(buffer, static_cast<size_t>(size));
}

}  // namespace

int TARQShareGet(const char* name, TARQShare* share) {
    host.calls.push_back(std::string("share ") + name);
    ++host.open_records;
    *share = new TARQShareRec{nullptr, const_cast<char*>(host.share_path), host.share_flags, 256};
    return host.has_share ? 0 : -1;
}
void TARQShareFree(TARQShare share) {
    host.open_records -= share != nullptr;
    delete share;
}
int KAPIShareEncryptPathGet(const char* path, char* buffer, int size) {
    EXPECT_EQ(size, 4095);
    Fill(buffer, size, std::string(path) + "/@storage@");
    return host.encrypt_path_result;
}
int VolumePathParseEx(const char* path, TARQVolumePath* volume) {
    host.calls.push_back(std::string("volume ") + path);
    Fill(volume->path, sizeof volume->path, host.volume_path);
    volume->type = host.volume_type;
    return host.volume_result;
}
int KAPICIsMiniUnit(void) {
    return host.small_device;
}
int TARQShareIsInSharebin(const char*) {
    return host.in_sharebin;
}
int TARQHAIsRunning(void) {
    return host.pair;
}
int KAPIGetSerialNumber(char* buffer, int size) {
    host.calls.push_back("serial " + std::to_string(size));
    Fill(buffer, size, host.serial);
    return 0;
}
int TARQHAGetMac(int, char* buffer, int size) {
    Fill(buffer, size, host.pair_mac);
    return 0;
}
int KAPINetGetInterfaceInfo(KAPINetInterface* records, int count, int flags) {
    EXPECT_EQ(count, 1);
    EXPECT_EQ(flags, 1);
    *records = {"eth0", {0x02, 0x00, 0x5E, 0xAB, 0x0C, 0xFF}};
    return host.interfaces;
}
int TARQLnxGetHostname(char* buffer) {
    Fill(buffer, 64, host.host_name);
    return host.host_name_result;
}
int TARQNetLookupIP(const char* name, TARQNetAddress* records, int count, int) {
    host.calls.push_back(std::string("look up ") + name + " " + std::to_string(count));
    for (size_t i = 0; i < host.addresses.size(); ++i) {
        Fill(records[i].address, sizeof records[i].address, host.addresses[i]);
    }
    return host.lookup_result < 0 ? host.lookup_result : static_cast<int>(host.addresses.size());
}
FILE* KAPICPopen(const char* program, const char* mode, ...) {
    std::string call = std::string(program) + " (" + mode + ")";
    va_list arguments;
    va_start(arguments, mode);
    while (const char* argument = va_arg(arguments, const char*)) {
        call += std::string(" ") + argument;
    }
    va_end(arguments);
    host.calls.push_back(call);
    if (!host.netbios_starts) {
        return nullptr;
    }
    ++host.open_programs;
    return fmemopen(host.netbios_answer.data(), host.netbios_answer.size(), "r");
}
int KAPICPclose(FILE* stream) {
    --host.open_programs;
    return fclose(stream);
}
int TARQSystemdActiveStatusGet(const char* unit) {
    EXPECT_STREQ(unit, "zel_daemon");
    return host.unit_status;
}
int TARQSystemdStart(const char* unit) {
    EXPECT_STREQ(unit, "zel_daemon");
    return host.unit_result;
}
int TARQSystemdStop(const char* unit) {
    EXPECT_STREQ(unit, "zel_daemon");
    return host.unit_result;
}
int KAPICErrGet(void) {
    return host.error;
}

namespace {

class HostTest : public testing::Test {
protected:
    HostTest() { host = {}; }
    ~HostTest() override {
        EXPECT_EQ(host.open_records, 0);
        EXPECT_EQ(host.open_programs, 0);
    }
    // What was logged since the last look, in a line each without the source tag.
    Strings Faults() {
        Strings faults;
        const Strings lines = log_.Lines();
        for (; seen_ < lines.size(); ++seen_) {
            EXPECT_EQ(lines[seen_].rfind("[ERROR] ZEL/zel(N): ", 0), 0U) << lines[seen_];
            faults.push_back(lines[seen_].substr(20));
        }
        return faults;
    }

    test::LogCapture log_;
    size_t seen_ = 0;
};

class Shares : public HostTest {};

TEST_F(Shares, AnEncryptedShareIsServedFromItsStorage) {
    host.share_flags = 0x2;
    ZEL::ShareInfo share;
    ASSERT_EQ(ZEL::GetShareInfo("docs", share), 0);
    EXPECT_EQ(share.GetName(), "docs");
    EXPECT_EQ(share.GetPath(), "/volume1/docs");
    EXPECT_EQ(share.GetModulePath(), "/volume1/docs/@storage@");
    EXPECT_EQ(share.GetModuleName(), "@docs@");
    EXPECT_EQ(share.GetEncryptKeyLen(), 256);
    host.share_flags = 0;
    ASSERT_EQ(ZEL::GetShareInfo("docs", share), 0);
    EXPECT_EQ(share.GetModulePath(), "/volume1/docs");
    EXPECT_EQ(share.GetModuleName(), "docs");
}

TEST_F(Shares, EachFlagHasItsBitAndWindowsSharesHaveAccessLists) {
    struct {
        unsigned int flags;
        const char* set;
    } const cases[] = {{0x2, "encrypted "},     {0x4, "mounted "},    {0x80, "acl "},
                       {0x800, "windows acl "}, {0x8000, "cluster "}, {~0x8886U, ""}};
    for (const auto& c : cases) {
        host.share_flags = c.flags;
        ZEL::ShareInfo share;
        ASSERT_EQ(ZEL::GetShareInfo("docs", share), 0);
        std::string set;
        set += share.IsEncrypted() ? "encrypted " : "";
        set += share.IsAutoMount() ? "mounted " : "";
        set += share.IsWinShare() ? "windows " : "";
        set += share.IsACL() ? "acl " : "";
        set += share.IsCluster() ? "cluster " : "";
        EXPECT_EQ(set, c.set);
    }
}

TEST_F(Shares, FailuresAreLoggedFromTheInnermostOut) {
    const auto check = [&](const std::string& name = "docs") {
        bool valid = true;
        EXPECT_EQ(ZEL::IsValidShare(name, valid), -1);
        EXPECT_TRUE(valid) << "touched";
        return Faults();
    };
    EXPECT_THAT(check(""), ElementsAre("Fail to get share info", "Fail to get volume info"));
    EXPECT_THAT(check(std::string("docs\0x", 6)),
                ElementsAre("Fail to get share 'docs'", "Fail to get share info",
                            "Fail to get volume info"));
    EXPECT_THAT(host.calls, IsEmpty());
    host.volume_result = -1;
    EXPECT_THAT(check(),
                ElementsAre("Fail to get volume info of share 'docs'", "Fail to get volume info"));
    host.share_flags = 0x2;
    host.encrypt_path_result = -1;
    EXPECT_THAT(check(), ElementsAre("Fail to get encrypted path of share 'docs'",
                                     "Fail to get share info", "Fail to get volume info"));
    host.share_path = nullptr;
    EXPECT_EQ(check()[0], "Fail to get the path of share 'docs'");
    host.has_share = false;
    EXPECT_EQ(check()[0], "Fail to get share 'docs'");
}

TEST_F(Shares, InternalVolumesAreValidByTheSharesOwnPath) {
    host.share_flags = 0x2;
    for (const unsigned int type : {0U, 1U, 2U, 0x80000001U}) {
        host.volume_type = type;
        bool valid = type != 1;
        EXPECT_EQ(ZEL::IsValidShare("docs", valid), 0);
        EXPECT_EQ(valid, type == 1);
    }
    EXPECT_EQ(host.calls[1], "volume /volume1/docs");
    ZEL::VolumeInfo volume;
    host.volume_path = "/volume2";
    ASSERT_EQ(ZEL::GetVolumeInfo("docs", volume), 0);
    EXPECT_EQ(volume.GetName(), "volume2");
    host.volume_path = "/" + std::string(127, 'v');  // fills its field
    ASSERT_EQ(ZEL::GetVolumeInfo("docs", volume), 0);
    EXPECT_EQ(volume.GetPath(), host.volume_path);
    EXPECT_THROW(ZEL::VolumeInfo().GetName(), std::out_of_range);
}

TEST_F(Shares, TheSmallFamilyNeverAsksForTheVolume) {
    host.small_device = true;
    for (const int answer : {1, 0, -1, 2}) {
        host.in_sharebin = answer;
        bool valid = answer != 1;
        EXPECT_EQ(ZEL::IsValidShare("docs", valid), 0);
        EXPECT_EQ(valid, answer == 1);
    }
    EXPECT_THAT(host.calls, IsEmpty());
}

class Identity : public HostTest {};

TEST_F(Identity, ClientIsTheSerialNumberElseAMacAddress) {
    EXPECT_EQ(ZEL::GetClientID(), "02:00:5e:ab:0c:ff");
    host.serial = std::string(40, 's');
    EXPECT_EQ(ZEL::GetClientID(), std::string(36, 's'));
    host.pair = true;
    EXPECT_EQ(ZEL::GetClientID(), host.serial);
    host.serial = "";
    host.pair_mac = "02:00:5e:00:00:01";
    EXPECT_EQ(ZEL::GetClientID(), host.pair_mac);
    EXPECT_THAT(host.calls, ElementsAre("serial 36", "serial 36", "serial 1024", "serial 1024"));
    EXPECT_THAT(Faults(), IsEmpty());
}

TEST_F(Identity, OnlyAPairLogsThatItHasNone) {
    host.interfaces = 0;
    EXPECT_EQ(ZEL::GetClientID(), "");
    EXPECT_THAT(Faults(), IsEmpty());
    host.pair = true;
    EXPECT_EQ(ZEL::GetClientID(), "");
    EXPECT_THAT(Faults(), ElementsAre("Fail to get ha sn and mac"));
}

TEST_F(Identity, HostNameKeepsItsTail) {
    const std::string longest(63, 'n');
    struct {
        std::string name;
        unsigned int skip;
        std::string kept;
    } const cases[] = {{"nas", 35, "nas"},
                       {std::string(35, 'n'), 35, std::string(35, 'n')},
                       {std::string(35, 'n') + "x", 35, "x"},
                       {longest + "x", 60, "nnnx"},
                       {"nas", 0, "nas"},
                       {"nas", 0xffffffff, "nas"}};
    for (const auto& c : cases) {
        host.host_name = c.name;
        EXPECT_EQ(ZEL::GetHostName(c.skip), c.kept);
    }
    host.host_name_result = -1;
    EXPECT_EQ(ZEL::GetHostName(0), "");
    EXPECT_THAT(Faults(), ElementsAre("Fail to call TARQLnxGetHostname"));
}

TEST_F(Identity, UsableAddresses) {
    const std::string literal(46, 'f');  // fills its field
    struct {
        const char* name;
        const char* address;
        const char* netbios;
        Strings found;
        Strings usable;
    } const cases[] = {
        {"", "10.0.0.5", "", {"10.0.0.7"}, {"10.0.0.5"}},
        {"", "", "", {}, {""}},
        {"server1", "", "", {literal, "10.0.0.8"}, {literal, "10.0.0.8"}},
        {"server1",
         "10.0.0.5",
         "Looking up\nSERVER1 <00>\n\tSERVER1         <00> -\n",
         {"10.0.0.7"},
         {"10.0.0.5"}},
        {"server1",
         "10.0.0.5",
         "\t\n\tOTHER <00>\n\tSERVER1 <00>\n",
         {"10.0.0.7", "10.0.0.8"},
         {"10.0.0.7", "10.0.0.8"}},
        {"longer_than_16_in_all",
         "10.0.0.5",
         "\tLONGER_THAN_16_IN_ALL\n",
         {"10.0.0.7"},
         {"10.0.0.7"}},
        {"server1", "10.0.0.5", "", {}, {"10.0.0.5"}},
        {"server1", "FE80::1", "x", {"10.0.0.7", "fe80::1"}, {"FE80::1"}},
    };
    for (const auto& c : cases) {
        host.netbios_answer = c.netbios;
        host.addresses = c.found;
        Strings out = {"before"};
        EXPECT_EQ(ZEL::GetUsableIP(c.name, c.address, out), 0);
        out.erase(out.begin());
        EXPECT_EQ(out, c.usable) << c.name << " " << c.address << " " << c.netbios;
    }
    EXPECT_THAT(Faults(), IsEmpty());
}

TEST_F(Identity, OnlyWhatIsNeededIsAsked) {
    Strings out;
    ZEL::GetUsableIP("", "10.0.0.5", out);
    EXPECT_THAT(host.calls, IsEmpty());
    host.netbios_answer = std::string(127, 'x') + "\tSERVER1 <00>\n\tSERVER1 <00>\n";
    ZEL::GetUsableIP("server1", "10.0.0.5", out);
    EXPECT_THAT(host.calls, ElementsAre("/usr/local/bin/nmblookup (r) -A 10.0.0.5"));
    host.calls.clear();
    host.addresses = {"10.0.0.7"};
    ZEL::GetUsableIP("server1", "--option", out);
    EXPECT_THAT(host.calls, ElementsAre("look up server1 20"));
}

TEST_F(Identity, AFailedLookUpAppendsNothing) {
    Strings out;
    EXPECT_EQ(ZEL::GetUsableIP("server1", "", out), -1);
    host.lookup_result = -1;
    host.addresses = {"10.0.0.7"};
    host.netbios_starts = false;
    EXPECT_EQ(ZEL::GetUsableIP("server1", "", out), -1);
    EXPECT_EQ(ZEL::GetUsableIP("server1", "10.0.0.5", out), -1);
    EXPECT_THAT(out, IsEmpty());
    EXPECT_THAT(Faults(), ElementsAre("nmblookup_r: popen error"));
}

class Service : public HostTest {};

TEST_F(Service, StartingToleratesABusyUnitAndStoppingDoesNot) {
    struct {
        int result;
        int error;
        int start;
        int stop;
    } const cases[] = {{1, 0xEA00, 0, 0}, {0, 0xEB00, 0, -1}, {0, 0xEA00, -1, -1}};
    for (const auto& c : cases) {
        host.unit_result = c.result;
        host.error = c.error;
        EXPECT_EQ(ZEL::StartDaemon(), c.start);
        EXPECT_EQ(ZEL::StopDaemon(), c.stop);
    }
    EXPECT_THAT(Faults(), ElementsAre("Fail to stop daemon, tarqerr=[0xEB00]",
                                      "Fail to start daemon, tarqerr=[0xEA00]",
                                      "Fail to stop daemon, tarqerr=[0xEA00]"));
    for (const int status : {1, 0, -1, 2}) {
        host.unit_status = status;
        EXPECT_EQ(ZEL::IsDaemonRunning(), status == 1);
    }
}

TEST_F(Service, TempFilesAreNewEmptyAndPrivate) {
    const test::TempRoot root;
    const std::string path = ZEL::GetTempFile();
    ASSERT_EQ(path.rfind(root.Path("tmp/ZEL/temp."), 0), 0U) << path;
    EXPECT_NE(ZEL::GetTempFile(), path);
    struct stat status = {};
    ASSERT_EQ(stat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0600U);
    EXPECT_EQ(status.st_size, 0);
    ZEL::PutTempFile("");
    ZEL::PutTempFile(path);
    EXPECT_FALSE(ZEL::IsPathExist(path));
    EXPECT_THAT(Faults(), IsEmpty());
    ZEL::PutTempFile(path);
    EXPECT_THAT(Faults(), ElementsAre("Fail to unlink temp file '" + path + "' [2]"));
    std::filesystem::remove_all(root.Path("tmp"));
    EXPECT_EQ(ZEL::GetTempFile(), "");
    EXPECT_THAT(Faults(), IsEmpty());
}

class Lock : public HostTest {
protected:
    test::TempFolder folder_;
    std::string path_ = folder_.Path("lock");
    ZEL::LockFactory factory_{path_};

    // Whether another process could take the lock now.
    bool IsFree() const {
        const int fd = open(path_.c_str(), O_RDWR | O_CLOEXEC);
        const bool free = flock(fd, LOCK_EX | LOCK_NB) == 0;
        close(fd);
        return free;
    }
};

TEST_F(Lock, IsHeldFromExLockToUnLockOrTheEnd) {
    {
        ZEL::SimpleFileLock lock = factory_.GetLock();
        EXPECT_EQ(lock.UnLock(), 0);
        EXPECT_EQ(lock.ExLock(), 0);
        EXPECT_EQ(lock.ExLock(), 0);
        EXPECT_FALSE(IsFree());
        EXPECT_EQ(lock.UnLock(), 0);
        EXPECT_TRUE(IsFree());
        EXPECT_EQ(lock.ExLock(), 0);

        ZEL::SimpleFileLock holder = std::move(lock);
        EXPECT_EQ(lock.ExLock(),
                  -1);  // NOLINT(bugprone-use-after-move): a moved-from lock is no lock
        EXPECT_FALSE(IsFree());
        holder = factory_.GetLock();
        EXPECT_TRUE(IsFree());
        EXPECT_EQ(holder.ExLock(), 0);
    }
    EXPECT_TRUE(IsFree());
    EXPECT_THAT(Faults(), IsEmpty());
}

TEST_F(Lock, FileIsPrivateAndStaysOutOfPrograms) {
    const ZEL::SimpleFileLock lock(path_);
    struct stat status = {};
    ASSERT_EQ(stat(path_.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0600U);
    int found = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        std::error_code gone;
        if (std::filesystem::read_symlink(entry, gone) == path_) {
            ++found;
            EXPECT_NE(fcntl(std::stoi(entry.path().filename()), F_GETFD) & FD_CLOEXEC, 0);
        }
    }
    EXPECT_EQ(found, 1);
}

TEST_F(Lock, WithoutItsFileFailsSilently) {
    const std::string path = folder_.Path("missing/lock");
    ZEL::SimpleFileLock lock(path);
    EXPECT_THAT(Faults(), ElementsAre("Fail to open lock file at '" + path +
                                      "', error:'No such file or directory'"));
    EXPECT_EQ(lock.ExLock(), -1);
    EXPECT_EQ(lock.UnLock(), 0);
    EXPECT_THAT(Faults(), IsEmpty());
}

TEST_F(Lock, WaitsThroughSignalsUntilItIsFree) {
    struct sigaction nothing = {};
    nothing.sa_handler = [](int) {};
    sigaction(SIGUSR1, &nothing, nullptr);
    ZEL::SimpleFileLock held = factory_.GetLock();
    ASSERT_EQ(held.ExLock(), 0);
    std::atomic<bool> started{false};
    std::atomic<bool> given_back{false};
    std::thread waiter([&] {
        ZEL::SimpleFileLock lock = factory_.GetLock();
        started = true;
        EXPECT_EQ(lock.ExLock(), 0);
        EXPECT_TRUE(given_back);
    });
    while (!started) {
        std::this_thread::yield();
    }
    for (int i = 0; i < 10; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
        pthread_kill(waiter.native_handle(), SIGUSR1);
    }
    given_back = true;
    EXPECT_EQ(held.UnLock(), 0);
    waiter.join();
}

}  // namespace
