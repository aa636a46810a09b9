#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <tarq/core.h>
#include <tarq/owners.h>
#include <tarq/share.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/tarqshare/mount_table.h"
#include "platform/tarqshare/volume.h"
#include "tests/support/temp_root.h"

namespace {

namespace fs = std::filesystem;
using tarq_share::FindMount;
using tarq_share::FindVolume;
using tarq_share::Mount;
using testing::ElementsAre;

struct ShareFree {
    void operator()(TARQShare share) const { TARQShareFree(share); }
};
using ShareOwner = std::unique_ptr<TARQShareRec, ShareFree>;

ShareOwner Get(const std::string& name) {
    TARQShare share = reinterpret_cast<TARQShare>(1);
    const int result = TARQShareGet(name.c_str(), &share);
    EXPECT_EQ(result < 0, share == nullptr);
    return ShareOwner(share);
}

/// The error of a call that fails; 0 of one that succeeds.
int ErrorOf(int result) {
    return result < 0 ? KAPICErrGet() : 0;
}
int ErrorOfGet(const std::string& name) {
    return ErrorOf(Get(name) ? 0 : -1);
}

std::vector<std::string> Names() {
    const TARQ::ListOwner list(KAPICSzListAlloc(0));
    EXPECT_EQ(TARQShareEnum(list.get()), 0);
    std::vector<std::string> names;
    names.reserve(static_cast<size_t>(KAPICSzListCount(list.get())));
    for (int i = 0; i < KAPICSzListCount(list.get()); ++i) {
        names.emplace_back(KAPICSzListGet(list.get(), i));
    }
    return names;
}

class Catalogue : public testing::Test {
protected:
    /// Makes a folder below the root; its path.
    std::string Folder(const std::string& name) const {
        fs::create_directories(root_.Path(name));
        return root_.Path(name);
    }
    int Add(const std::string& name, const std::string& path, unsigned int flags = 0) const {
        return ErrorOf(TARQShareAdd(name.c_str(), path.c_str(), flags));
    }
    void WriteCatalogue(const std::string& text) const {
        root_.Write("usr/tarq/etc/tarqshare.conf", text);
    }

    test::TempRoot root_;
};

// ---- The mount table ----

TEST(MountTable, IsReadWithEscapesOptionalFieldsAndMissingSources) {
    const std::vector<Mount> table = tarq_share::ParseMountTable(
        "27 1 254:0 / / rw,relatime - ext4 /dev/vda rw\n"
        "28 27 8:1 /sub /mnt/my\\040disk\\134x rw shared:1 master:2 - ext4 /dev/sda1 rw\n"
        "29 27 0:40 / /none rw -  tmpfs\n"
        "30 27 0:41 / /blank rw - tmpfs  rw,size=4k\n"
        "not a line\n\n31 27 8 / /x rw - ext4 /dev/sdb rw\n"
        "99999999999999999999 27 8:1 / /x rw - ext4 /dev/sdb rw\n"
        "32 27 8:1 / /cut rw\n");
    ASSERT_EQ(table.size(), 4U);
    EXPECT_EQ(table[1].mount_point, "/mnt/my disk\\x");
    EXPECT_EQ(table[1].root, "/sub");
    EXPECT_EQ(table[1].source, "/dev/sda1");
    EXPECT_EQ(table[1].major, 8U);
    EXPECT_EQ(table[1].parent_id, 27U);
    EXPECT_EQ(table[3].type, "tmpfs");
    EXPECT_EQ(table[3].source, "");
}

TEST(MountTable, LongestMountPointHoldsThePathAndTheLastOfEqualOnes) {
    const std::vector<Mount> table = tarq_share::ParseMountTable(
        "1 0 8:1 / / rw - ext4 /dev/a rw\n2 1 8:2 / /volume1 rw - ext4 /dev/b rw\n"
        "3 2 8:3 / /volume1/docs rw - ext4 /dev/c rw\n4 3 8:4 / /volume1/docs rw - ext4 /dev/d "
        "rw\n");
    const auto id_of = [&](const char* path) { return FindMount(table, path, std::nullopt)->id; };
    EXPECT_EQ(id_of("/volume1"), 2U);
    EXPECT_EQ(id_of("/volume1/docsx"), 2U);
    EXPECT_EQ(id_of("/volume1/docs/a"), 4U);
    EXPECT_EQ(id_of("/volume10"), 1U);
    EXPECT_EQ(FindMount(table, "/volume1/docs/a", 3)->id, 3U);
    EXPECT_EQ(FindMount({}, "/", std::nullopt), nullptr);
}

// ---- Volumes, on a machine of the test's own ----

class FakeHost : public testing::Test {
protected:
    FakeHost() {
        // The name of the bus stands above the folder, where it says nothing about any disk.
        host_.sys = folder_.Path("usb9/sys");
        host_.dev = folder_.Path("dev");
        host_.udev_data = folder_.Path("udev");
        host_.mount_table = folder_.Path("mountinfo");
        host_.kernel_mount_ids = false;
    }

    /// A block device in /sys, such as a partition "devices/pci/ata1/block/sda/sda1" with the
    /// number "8:1".
    void MakeDevice(const std::string& path, const std::string& number) {
        folder_.Write("usb9/sys/" + path + "/dev", number + "\n");
        for (const std::string& link :
             {"usb9/sys/dev/block/" + number,
              "usb9/sys/class/block/" + fs::path(path).filename().string()}) {
            fs::create_directories(fs::path(folder_.Path(link)).parent_path());
            fs::create_directory_symlink(folder_.Path("usb9/sys/" + path), folder_.Path(link));
        }
    }
    void MakeSlave(const std::string& mapped, const std::string& disk) {
        fs::create_directories(folder_.Path("usb9/sys/" + mapped + "/slaves"));
        fs::create_directory_symlink(
            folder_.Path("usb9/sys/" + disk),
            folder_.Path("usb9/sys/" + mapped + "/slaves/" + fs::path(disk).filename().string()));
    }
    /// What is mounted at <folder>/<point>.
    void Mount(const std::string& point, const std::string& number, const std::string& type,
               const std::string& source) {
        fs::create_directories(folder_.Path(point));
        mounts_ += std::to_string(++last_id_) + " 1 " + number + " / " + folder_.Path(point) +
                   " rw - " + type + " " + source + " rw\n";
        folder_.Write("mountinfo", mounts_);
    }
    tarq_share::Volume At(const std::string& point) {
        const auto volume = FindVolume(folder_.Path(point), host_);
        return volume ? *volume : tarq_share::Volume{};
    }

    test::TempFolder folder_;
    tarq_share::HostFolders host_;
    std::string mounts_;
    int last_id_ = 1;
};

TEST_F(FakeHost, DisksAreToldApartByWhereTheyArePluggedIn) {
    const struct {
        const char* path;
        unsigned int type;
    } disks[] = {
        {"devices/pci/ata1/block/sda/sda1", TARQ_VOLUME_INTERNAL},
        {"devices/pci/0000:00:14.0/usb2/2-1/host6/block/sdb/sdb1", TARQ_VOLUME_EXTERNAL},
        {"devices/pci/fw0/fw1.0/block/sdc/sdc1", TARQ_VOLUME_EXTERNAL},
        {"devices/pci/ata2/block/sdd/sdd1", TARQ_VOLUME_EXTERNAL},  // removable
        {"devices/platform/mmc_host/mmc0/block/mmcblk0/mmcblk0p1", TARQ_VOLUME_EXTERNAL},
        {"devices/platform/mmc_host/mmc1/block/mmcblk1/mmcblk1p1",
         TARQ_VOLUME_INTERNAL},  // soldered
        {"devices/virtual/block/dm-0", TARQ_VOLUME_INTERNAL},
        {"devices/virtual/block/dm-1", TARQ_VOLUME_EXTERNAL},
        {"devices/virtual/block/dm-2", TARQ_VOLUME_INTERNAL},  // maps itself
    };
    int minor = 0;
    for (const auto& disk : disks) {
        const std::string number = "8:" + std::to_string(++minor);
        MakeDevice(disk.path, number);
        Mount("m" + std::to_string(minor), number, "ext4", "/dev/x");
        if (std::string(disk.path).find("dm-") == std::string::npos) {
            folder_.Write(std::string("usb9/sys/") + disk.path + "/partition", "1\n");
        }
    }
    folder_.Write("usb9/sys/devices/pci/ata2/block/sdd/removable", "1\n");
    folder_.Write("usb9/sys/devices/platform/mmc_host/mmc0/block/mmcblk0/device/type", "SD\n");
    folder_.Write("usb9/sys/devices/platform/mmc_host/mmc1/block/mmcblk1/device/type", "MMC\n");
    MakeSlave("devices/virtual/block/dm-0", disks[0].path);
    MakeSlave("devices/virtual/block/dm-1", "devices/virtual/block/dm-0");
    MakeSlave("devices/virtual/block/dm-1", disks[1].path);
    MakeSlave("devices/virtual/block/dm-2", "devices/virtual/block/dm-2");

    minor = 0;
    for (const auto& disk : disks) {
        EXPECT_EQ(At("m" + std::to_string(++minor)).type, disk.type) << disk.path;
    }
}

TEST_F(FakeHost, FileSystemsWithoutADiskAreToldApartByTheirKind) {
    MakeDevice("devices/pci/usb1/1-1/block/sdb", "8:16");
    const struct {
        const char *type, *source;
        unsigned int expected;
    } mounts[] = {
        {"nfs4", "nas:/export", TARQ_VOLUME_REMOTE}, {"cifs", "//nas/docs", TARQ_VOLUME_REMOTE},
        {"fuse.sshfs", "nas:", TARQ_VOLUME_REMOTE},  {"9p", "host", TARQ_VOLUME_REMOTE},
        {"tmpfs", "tmpfs", TARQ_VOLUME_INTERNAL},    {"overlay", "overlay", TARQ_VOLUME_INTERNAL},
        {"zfs", "tank/docs", TARQ_VOLUME_INTERNAL},  {"fuse.mergerfs", "a:b", TARQ_VOLUME_INTERNAL},
        {"fuse.what", "what", TARQ_VOLUME_UNKNOWN},  {"btrfs", "/dev/sdb", TARQ_VOLUME_EXTERNAL},
    };
    for (const auto& mount : mounts) {
        Mount(mount.type, "0:50", mount.type, mount.source);
        EXPECT_EQ(At(mount.type).type, mount.expected) << mount.type;
        EXPECT_EQ(At(mount.type).mount_point, folder_.Path(mount.type));
    }
}

TEST_F(FakeHost, FolderShownThroughAnotherFileSystemLiesOnTheFirstOnesVolume) {
    MakeDevice("devices/pci/usb1/1-1/block/sdb", "8:16");
    Mount("disk", "8:16", "ext4", "/dev/sdb");
    fs::create_directories(folder_.Path("disk/@docs@"));
    Mount("disk/docs", "0:60", "ecryptfs", folder_.Path("disk/@docs@"));
    Mount("disk/self", "0:61", "ecryptfs", folder_.Path("disk/self"));
    EXPECT_EQ(At("disk/docs").mount_point, folder_.Path("disk"));
    EXPECT_EQ(At("disk/docs").type, TARQ_VOLUME_EXTERNAL);
    EXPECT_NE(At("disk/self").mount_point, "");
    EXPECT_EQ(At("nowhere").mount_point, "");
}

TEST_F(FakeHost, UuidComesFromTheDeviceManagersDatabaseOrItsLinks) {
    MakeDevice("devices/pci/ata1/block/sda/sda1", "8:1");
    Mount("volume", "8:1", "ext4", "/dev/sda1");
    EXPECT_EQ(At("volume").uuid, "");
    fs::create_directories(folder_.Path("dev/disk/by-uuid"));
    fs::create_symlink("../../sdb1", folder_.Path("dev/disk/by-uuid/other"));
    fs::create_symlink("../../sda1", folder_.Path("dev/disk/by-uuid/1234-ABCD"));
    EXPECT_EQ(At("volume").uuid, "1234-ABCD");
    folder_.Write("udev/b8:1", "S:disk/by-id/x\nE:ID_FS_UUID_ENC=no\nE:ID_FS_UUID=0f-1e\n");
    EXPECT_EQ(At("volume").uuid, "0f-1e");
}

TEST(Volume, IsTheSameAsRecordedOnlyInItsPlaceAndWithItsFileSystem) {
    const tarq_share::Volume recorded{"/volume1", "ext4", "A", 1};
    EXPECT_TRUE(IsSameVolume(recorded, {"/volume1", "ext4", "A", 1}));
    EXPECT_TRUE(IsSameVolume(recorded, {"/volume1", "ext4", "", 1}));
    EXPECT_FALSE(IsSameVolume(recorded, {"/", "ext4", "A", 1}));
    EXPECT_FALSE(IsSameVolume(recorded, {"/volume1", "tmpfs", "", 1}));
    EXPECT_FALSE(IsSameVolume(recorded, {"/volume1", "ext4", "B", 1}));
}

// ---- The catalogue ----

TEST_F(Catalogue, KeepsWhatWasAdded) {
    EXPECT_THAT(Names(), ElementsAre());
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_NO_SHARE);
    const std::string docs = Folder("v/docs");
    const std::string photos = Folder("v/Fotos für = alle's");
    ASSERT_EQ(Add("docs", docs + "//", TARQ_SHARE_ACL | TARQ_SHARE_WINDOWS | 0x10000), 0);
    ASSERT_EQ(Add("Fotos für = alle's", photos), 0);
    EXPECT_THAT(Names(), ElementsAre("docs", "Fotos für = alle's"));

    const ShareOwner share = Get("docs");
    ASSERT_TRUE(share);
    EXPECT_STREQ(share->name, "docs");
    EXPECT_EQ(share->path, docs);
    EXPECT_EQ(share->flags, TARQ_SHARE_ACL | TARQ_SHARE_WINDOWS | 0x10000U);
    EXPECT_EQ(share->enc_key_len, 0);
    EXPECT_EQ(Get("Fotos für = alle's")->path, photos);

    EXPECT_EQ(ErrorOf(TARQShareRemove("docs")), 0);
    EXPECT_EQ(ErrorOf(TARQShareRemove("docs")), TARQ_ERR_NO_SHARE);
    EXPECT_THAT(Names(), ElementsAre("Fotos für = alle's"));
    EXPECT_TRUE(fs::exists(docs));
}

TEST_F(Catalogue, RefusesNamesThatWouldBreakWhatTheyBecome) {
    const std::string folder = Folder("v/docs");
    for (const std::string name : {"",
                                   ".hidden",
                                   "@docs@",
                                   "a/b",
                                   "a:b",
                                   "a\"b",
                                   "a]b",
                                   "[a",
                                   "a\\b",
                                   "a*",
                                   "a?",
                                   "a\nb",
                                   "a\tb",
                                   "a\x7f",
                                   " a",
                                   "a ",
                                   "a  b",
                                   "global",
                                   "GLOBAL",
                                   "zel_command",
                                   "a\xff",
                                   "a\xc0\xaf",
                                   "a\xed\xa0\x80",
                                   "a\xe2\x82"}) {
        EXPECT_EQ(Add(name, folder), TARQ_ERR_BAD_PARAMETER) << name;
    }
    EXPECT_EQ(Add(std::string(81, 'n'), folder), TARQ_ERR_BAD_PARAMETER);
    EXPECT_EQ(Add(std::string(80, 'n'), folder), 0);
}

TEST_F(Catalogue, RefusesFoldersThatAreNotThereOrAreTaken) {
    root_.Write("v/file", "");
    EXPECT_EQ(Add("a", "v/docs"), TARQ_ERR_BAD_PARAMETER);
    EXPECT_EQ(Add("a", "/"), TARQ_ERR_BAD_PARAMETER);
    EXPECT_EQ(Add("a", root_.Path("v/none")), TARQ_ERR_SHARE_FOLDER);
    EXPECT_EQ(Add("a", root_.Path("v/file")), TARQ_ERR_SHARE_FOLDER);

    ASSERT_EQ(Add("a", Folder("v/docs")), 0);
    EXPECT_EQ(Add("a", Folder("v/other")), TARQ_ERR_SHARE_EXISTS);
    EXPECT_EQ(Add("A", Folder("v/other")), TARQ_ERR_SHARE_EXISTS);
    EXPECT_EQ(Add("b", root_.Path("v/docs")), TARQ_ERR_SHARE_OVERLAP);
    EXPECT_EQ(Add("b", Folder("v/docs/inner")), TARQ_ERR_SHARE_OVERLAP);
    EXPECT_EQ(Add("b", root_.Path("v")), TARQ_ERR_SHARE_OVERLAP);
    fs::create_directory_symlink(root_.Path("v/docs"), root_.Path("v/link"));
    EXPECT_EQ(Add("b", root_.Path("v/link")), TARQ_ERR_SHARE_OVERLAP);
    EXPECT_EQ(Add("b", Folder("v/docs2")), 0);
}

TEST_F(Catalogue, ReadsSectionsThatPeopleWrote) {
    const std::string folder = Folder("v/docs");
    const std::string path = "path=\"" + folder + "\"\n";
    WriteCatalogue("[names]\n" + path +
                   "flags=\"acl, 0x800|32768\"\nkey_length=\"256\"\n[no path]\nflags=\"\"\n" +
                   "[bad flag]\n" + path + "flags=\"encrpyted\"\n[bad length]\n" + path +
                   "key_length=\"-1\"\n" + "[huge]\n" + path +
                   "flags=\"0x1ffffffff\"\n[relative]\npath=\"docs\"\n" + "[elsewhere]\n" + path +
                   "volume=\"/nowhere/mounted\"\n[other kind]\n" + path +
                   "volume=\"/\"\nvolume_fs=\"nosuchfs\"\n" + "[gone]\npath=\"" +
                   root_.Path("v/gone") + "\"\n");
    const ShareOwner share = Get("names");
    ASSERT_TRUE(share);
    EXPECT_EQ(share->flags, TARQ_SHARE_ACL | TARQ_SHARE_WINDOWS | TARQ_SHARE_CLUSTER);
    EXPECT_EQ(share->enc_key_len, 256);
    ASSERT_TRUE(Get("no path"));
    EXPECT_EQ(Get("no path")->path, nullptr);
    for (const char* name : {"bad flag", "bad length", "huge", "relative"}) {
        EXPECT_EQ(ErrorOfGet(name), TARQ_ERR_BAD_PARAMETER) << name;
    }
    EXPECT_EQ(ErrorOfGet("elsewhere"), TARQ_ERR_SHARE_VOLUME);
    EXPECT_EQ(ErrorOfGet("other kind"), TARQ_ERR_SHARE_VOLUME);
    EXPECT_EQ(ErrorOfGet("gone"), TARQ_ERR_SHARE_FOLDER);
}

TEST_F(Catalogue, EncryptedShareIsWhereItsStorageIs) {
    const std::string docs = Folder("v/docs");
    constexpr unsigned int kFlags = TARQ_SHARE_ENCRYPTED | TARQ_SHARE_AUTO_MOUNT;
    EXPECT_EQ(Add("docs", docs, kFlags), TARQ_ERR_SHARE_FOLDER);
    const std::string storage = Folder("v/@docs@");
    ASSERT_EQ(Add("docs", docs, kFlags), 0);
    ASSERT_EQ(Add("plain", Folder("v/plain"), TARQ_SHARE_AUTO_MOUNT), 0);
    EXPECT_EQ(Add("inside", storage), TARQ_ERR_SHARE_OVERLAP);

    char buffer[4096];
    EXPECT_EQ(KAPIShareEncryptPathGet(docs.c_str(), buffer, 4095), 0);
    EXPECT_EQ(buffer, storage);
    EXPECT_LT(KAPIShareEncryptPathGet(docs.c_str(), buffer, static_cast<int>(storage.size())), 0);
    EXPECT_EQ(ErrorOf(KAPIShareEncryptPathGet(root_.Path("v/plain").c_str(), buffer, 4095)),
              TARQ_ERR_NO_SHARE);

    fs::remove(docs);  // a closed share shows no folder, and travels all the same
    const ShareOwner share = Get("docs");
    const ShareOwner plain = Get("plain");
    ASSERT_TRUE(share && plain);
    int encrypted = -1;
    int automatic = -1;
    EXPECT_EQ(KAPIShareIsEncryptionGet(share.get(), &encrypted) +
                  KAPIShareIsAutoDecryptGet(share.get(), &automatic),
              0);
    EXPECT_EQ(encrypted + automatic, 2);
    EXPECT_EQ(KAPIShareIsEncryptionGet(plain.get(), &encrypted) +
                  KAPIShareIsAutoDecryptGet(plain.get(), &automatic),
              0);
    EXPECT_EQ(encrypted + automatic, 0);

    EXPECT_EQ(TARQShareEncAutoKeyFileGet(share.get(), buffer, sizeof buffer), 0);
    EXPECT_EQ(buffer, root_.Path("usr/tarq/etc/.encrypt/docs"));
    EXPECT_EQ(TARQShareEncKeyFileGet(share.get(), buffer, sizeof buffer), 0);
    EXPECT_EQ(buffer, root_.Path("usr/tarq/etc/.encrypt/@docs"));
    EXPECT_LT(TARQShareEncKeyFileGet(share.get(), buffer, 8), 0);

    fs::remove(storage);
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_FOLDER);
    WriteCatalogue("[docs]\npath=\"" + docs + "\"\nflags=\"encrypted\"\nencrypted_path=\"" +
                   Folder("v/vault") + "\"\nkey_file=\"/k/exported\"\nauto_key_file=\"/k/auto\"\n");
    EXPECT_EQ(KAPIShareEncryptPathGet(docs.c_str(), buffer, 4095), 0);
    EXPECT_EQ(buffer, root_.Path("v/vault"));
    EXPECT_EQ(TARQShareEncAutoKeyFileGet(share.get(), buffer, sizeof buffer), 0);
    EXPECT_STREQ(buffer, "/k/auto");
    EXPECT_EQ(TARQShareEncKeyFileGet(share.get(), buffer, sizeof buffer), 0);
    EXPECT_STREQ(buffer, "/k/exported");
}

TEST_F(Catalogue, WritersDoNotLoseEachOthersShares) {
    constexpr int kWriters = 4;
    constexpr int kShares = 6;
    std::vector<std::thread> writers;
    writers.reserve(kWriters);
    for (int writer = 0; writer < kWriters; ++writer) {
        writers.emplace_back([this, writer] {
            for (int i = 0; i < kShares; ++i) {
                const std::string name = std::to_string(writer) + "-" + std::to_string(i);
                EXPECT_EQ(Add(name, Folder("v/" + name)), 0);
            }
        });
    }
    for (std::thread& writer : writers) {
        writer.join();
    }
    EXPECT_EQ(Names().size(), static_cast<size_t>(kWriters * kShares));
}

TEST_F(Catalogue, VolumeOfAPathThatDoesNotExistIsAnError) {
    TARQVolumePath volume{};
    EXPECT_EQ(VolumePathParseEx(root_.Path().c_str(), &volume), 0);
    EXPECT_EQ(volume.path[0], '/');
    EXPECT_EQ(ErrorOf(VolumePathParseEx(root_.Path("none").c_str(), &volume)), TARQ_ERR_NO_VOLUME);
}

/// Runs `body` in a process with mounts of its own; false when this machine does not let us.
bool InPrivateMounts(const std::function<void()>& body) {
    constexpr int kNotAllowed = 77;
    fflush(nullptr);
    const pid_t child = fork();
    if (child == 0) {
        if (unshare(CLONE_NEWNS) != 0 ||
            mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
            _exit(kNotAllowed);
        }
        body();
        fflush(nullptr);
        _exit(testing::Test::HasFailure() ? 1 : 0);
    }
    int status = 0;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status));
    if (WEXITSTATUS(status) == kNotAllowed) {
        return false;
    }
    EXPECT_EQ(WEXITSTATUS(status), 0);
    return true;
}

TEST_F(Catalogue, EmptyMountPointIsNeverAnEmptiedShare) {
    const std::string volume = Folder("my volume");
    const bool ran = InPrivateMounts([&] {
        const auto mount_at = [](const std::string& point, const char* type) {
            return mount("none", point.c_str(), type, 0, nullptr);
        };
        ASSERT_EQ(mount_at(volume, "tmpfs"), 0);
        ASSERT_EQ(Add("docs", Folder("my volume/docs")), 0);
        ASSERT_EQ(Add("all", Folder("my volume/all")), 0);
        EXPECT_EQ(ErrorOfGet("docs"), 0);
        TARQVolumePath found{};
        EXPECT_EQ(VolumePathParseEx(root_.Path("my volume/docs").c_str(), &found), 0);
        EXPECT_EQ(found.path, volume);

        fs::remove(root_.Path("my volume/docs"));
        EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_FOLDER);
        ASSERT_EQ(umount(volume.c_str()), 0);
        EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME);
        Folder("my volume/docs");
        EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME);
        ASSERT_EQ(mount_at(volume, "ramfs"), 0);
        Folder("my volume/docs");
        EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME);
        ASSERT_EQ(umount(volume.c_str()), 0);

        // What a mount hides is not there, however well its mount point fits the path.
        ASSERT_EQ(mount_at(Folder("my volume/all/deep"), "tmpfs"), 0);
        ASSERT_EQ(mount_at(volume, "tmpfs"), 0);
        EXPECT_EQ(VolumePathParseEx(Folder("my volume/all/deep").c_str(), &found), 0);
        EXPECT_EQ(found.path, volume);
        ASSERT_EQ(umount(volume.c_str()), 0);
        ASSERT_EQ(umount(root_.Path("my volume/all/deep").c_str()), 0);

        // Another volume over the share's own folder hides its files just as well.
        ASSERT_EQ(mount_at(volume, "tmpfs"), 0);
        ASSERT_EQ(mount_at(Folder("my volume/docs"), "tmpfs"), 0);
        EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME);
    });
    if (!ran) {
        GTEST_SKIP() << "mounts of one's own need root";
    }
}

}  // namespace
