#include <sched.h>
#include <sys/mount.h>
#include <tarq/core.h>
#include <tarq/owners.h>
#include <tarq/share.h>

#include "platform/tarqshare/mount_table.h"
#include "platform/tarqshare/volume.h"
#include "tests/support/testing.h"

namespace {

using tarq_share::FindMount;

// ---- The mount table ----

TEST(MountTable, LongestMountPointHoldsThePathAndTheLastOfEqualOnes) {
    const auto table = tarq_share::ParseMountTable(
        "1 0 8:1 / / rw - ext4 /dev/a rw\n2 1 8:2 / /volume1 rw - ext4 /dev/b rw\n"
        "3 2 8:3 /sub /volume1/my\\040docs\\134x rw shared:1 master:2 - ext4 /dev/c rw\n"
        "4 3 8:4 / /volume1/my\\040docs\\134x rw - tmpfs  rw,size=4k\n"
        "not a line\n\n31 27 8 / /x rw - ext4 /dev/sdb rw\n"
        "99999999999999999999 27 8:1 / /x rw - ext4 /dev/sdb rw\n32 27 8:1 / /cut rw\n");
    ASSERT_EQ(table.size(), 4U);
    EXPECT_EQ(table[2].source, "/dev/c");
    EXPECT_EQ(table[3].type + table[3].source, "tmpfs");
    EXPECT_EQ(FindMount(table, "/volume1/my docs\\xx", {})->id, 2U);
    EXPECT_EQ(FindMount(table, "/volume1/my docs\\x/a", {})->id, 4U);
    EXPECT_EQ(FindMount(table, "/volume1/my docs\\x/a", 3)->id, 3U);
    EXPECT_EQ(FindMount(table, "/volume10", {})->id, 1U);
    EXPECT_EQ(FindMount({}, "/", {}), nullptr);
}

// ---- Volumes, on a machine of the test's own ----

class FakeHost : public testing::Test {
protected:
    FakeHost() {
        // The name of the bus stands above the folder, where it says nothing about any disk.
        host_ = {folder_.Path("mountinfo"), folder_.Path("usb9/sys"), folder_.Path("dev"),
                 folder_.Path("udev"), false};
    }

    void Link(const std::string& from, const std::string& to) const {
        fs::create_directories(fs::path(from).parent_path());
        fs::create_directory_symlink(to, from);
    }
    /// A block device, such as the partition "pci/ata1/block/sda/sda1" with the number "8:1".
    void MakeDevice(const fs::path& path, const std::string& number) const {
        const std::string folder = "usb9/sys/devices/" + path.string();
        folder_.Write(folder + "/dev", number + "\n");
        if (path.parent_path().filename() != "block") {
            folder_.Write(folder + "/partition", "1\n");
        }
        Link(host_.sys + "/dev/block/" + number, folder_.Path(folder));
        Link(host_.sys + "/class/block/" + path.filename().string(), folder_.Path(folder));
    }
    void Mount(const std::string& point, const std::string& number, const std::string& source) {
        fs::create_directories(folder_.Path(point));
        mounts_ += std::to_string(++last_id_) + " 1 " + number + " / " + folder_.Path(point) +
                   " rw - " + source + " rw\n";
        folder_.Write("mountinfo", mounts_);
    }
    tarq_share::Volume At(const std::string& point) const {
        return tarq_share::FindVolume(folder_.Path(point), host_)
            .value_or(tarq_share::Volume{"none", "", "", 99});
    }

    const test::TempFolder folder_;
    tarq_share::HostFolders host_;
    std::string mounts_;
    int last_id_ = 1;
};

TEST_F(FakeHost, VolumesAreToldApartByWhereTheirDisksArePluggedInElseByTheirKind) {
    constexpr auto kInternal = TARQ_VOLUME_INTERNAL;
    constexpr auto kExternal = TARQ_VOLUME_EXTERNAL;
    const struct {
        const char *device, *number, *source;  // the source with the file system's kind before it
        unsigned int type;
    } volumes[] = {
        {"pci/ata1/block/sda/sda1", "8:1", "ext4 /dev/sda1", kInternal},
        {"pci/0000:00:14.0/usb2/2-1/host6/block/sdb", "8:2", "ext4 /dev/x", kExternal},
        {"pci/fw0/fw1.0/block/sdc/sdc1", "8:3", "ext4 /dev/x", kExternal},
        {"pci/ata2/block/sdd/sdd1", "8:4", "ext4 /dev/x", kExternal},  // removable
        {"platform/mmc_host/mmc0/block/mmcblk0/mmcblk0p1", "8:5", "ext4 /dev/x", kExternal},
        {"platform/mmc_host/mmc1/block/mmcblk1/mmcblk1p1", "8:6", "ext4 /dev/x", kInternal},
        {"virtual/block/dm-1", "8:7", "ext4 /dev/x", kExternal},
        {"virtual/block/dm-0", "8:8", "ext4 /dev/x", kExternal},  // sda and, below dm-1, sdb
        {"virtual/block/dm-2", "8:9", "ext4 /dev/x", kInternal},  // maps itself
        {nullptr, "0:50", "nfs4 nas:/export", TARQ_VOLUME_REMOTE},
        {nullptr, "0:50", "zfs tank/docs", kInternal},
        {nullptr, "0:50", "fuse.mergerfs a:b", kInternal},
        {nullptr, "0:50", "fuse.what what", TARQ_VOLUME_UNKNOWN},
        {nullptr, "0:50", "btrfs /dev/sdb", kExternal},
    };
    const std::string devices = folder_.Path("usb9/sys/devices/");
    for (const auto& [slave, disk] : {std::pair("dm-0/slaves/1", volumes[0].device),
                                      std::pair("dm-0/slaves/2", "virtual/block/dm-1"),
                                      std::pair("dm-1/slaves/1", volumes[1].device),
                                      std::pair("dm-2/slaves/1", "virtual/block/dm-2")}) {
        Link(devices + "virtual/block/" + slave, devices + disk);
    }
    const std::string cards = "usb9/sys/devices/platform/mmc_host/";
    folder_.Write(cards + "mmc0/block/mmcblk0/device/type", "SD");
    folder_.Write(cards + "mmc1/block/mmcblk1/device/type", "MMC");
    folder_.Write("usb9/sys/devices/pci/ata2/block/sdd/removable", "1\n");
    for (const auto& volume : volumes) {
        if (volume.device != nullptr) {
            MakeDevice(volume.device, volume.number);
        }
        Mount("volume", volume.number, volume.source);
        EXPECT_EQ(At("volume").type, volume.type) << volume.number << " " << volume.source;
    }
}

TEST_F(FakeHost, FolderShownThroughAnotherFileSystemLiesOnTheFirstOnesVolume) {
    MakeDevice("pci/usb1/1-1/block/sdb", "8:16");
    Mount("disk", "8:16", "ext4 /dev/sdb");
    fs::create_directories(folder_.Path("disk/@docs@"));
    Mount("disk/docs", "0:60", "ecryptfs " + folder_.Path("disk/@docs@"));
    Mount("disk/self", "0:61", "ecryptfs " + folder_.Path("disk/self"));
    EXPECT_EQ(At("disk/docs").mount_point, folder_.Path("disk"));
    EXPECT_NE(At("disk/self").mount_point, "none");
    EXPECT_EQ(At("nowhere").mount_point, "none");
    // Its UUID comes from the device manager's database or, where there is none, its links.
    Link(folder_.Path("dev/disk/by-uuid/other"), "../../sdb1");
    EXPECT_EQ(At("disk/docs").uuid, "");
    Link(folder_.Path("dev/disk/by-uuid/1234-ABCD"), "../../sdb");
    EXPECT_EQ(At("disk/docs").uuid, "1234-ABCD");
    folder_.Write("udev/b8:16", "S:disk/by-id/x\nE:ID_FS_UUID_ENC=no\nE:ID_FS_UUID=0f-1e\n");
    EXPECT_EQ(At("disk/docs").uuid, "0f-1e");
}

TEST(Volume, WithAnotherUuidOrElsewhereIsNotTheRecordedOne) {
    const tarq_share::Volume recorded{"/volume1", "ext4", "A", 1};
    EXPECT_TRUE(IsSameVolume(recorded, {"/volume1", "ext4", "", 1}));
    EXPECT_FALSE(IsSameVolume(recorded, {"/", "ext4", "A", 1}));
    EXPECT_FALSE(IsSameVolume(recorded, {"/volume1", "tmpfs", "", 1}));
    EXPECT_FALSE(IsSameVolume(recorded, {"/volume1", "ext4", "B", 1}));
}

// ---- The catalogue ----

/// The error of a call that fails; 0 of one that succeeds.
int ErrorOf(int result) {
    return result < 0 ? KAPICErrGet() : 0;
}
TARQ::ShareOwner Get(const std::string& name) {
    TARQShare share = nullptr;
    TARQShareGet(name.c_str(), &share);
    return TARQ::ShareOwner(share);
}
int ErrorOfGet(const std::string& name) {
    return ErrorOf(Get(name) ? 0 : -1);
}
/// The names of all shares, with a line end behind each.
std::string Names() {
    const TARQ::ListOwner list(KAPICSzListAlloc(0));
    EXPECT_EQ(TARQShareEnum(list.get()), 0);
    std::string names;
    for (int i = 0; i < KAPICSzListCount(list.get()); ++i) {
        names += KAPICSzListGet(list.get(), i) + std::string("\n");
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
    static int Add(const std::string& name, const std::string& path, unsigned int flags = 0) {
        return ErrorOf(TARQShareAdd(name.c_str(), path.c_str(), flags));
    }
    void WriteCatalogue(const std::string& text) const {
        root_.Write("usr/tarq/etc/tarqshare.conf", text);
    }

    const test::TempRoot root_;
};

TEST_F(Catalogue, KeepsWhatWasAddedAndRemovesNoFolder) {
    constexpr unsigned int kFlags = TARQ_SHARE_ACL | TARQ_SHARE_WINDOWS | 0x10000;
    const std::string photos = Folder("v/Fotos für = alle's");
    ASSERT_EQ(Add("Fotos für = alle's", photos + "//", kFlags), 0);
    EXPECT_EQ(Names(), "Fotos für = alle's\n");
    EXPECT_EQ(Get("Fotos für = alle's")->path, photos);
    EXPECT_EQ(Get("Fotos für = alle's")->flags, kFlags);
    EXPECT_EQ(ErrorOf(TARQShareRemove("Fotos für = alle's")), 0);
    EXPECT_EQ(ErrorOfGet("Fotos für = alle's"), TARQ_ERR_NO_SHARE);
    EXPECT_TRUE(fs::exists(photos));
}

TEST_F(Catalogue, RefusesNamesThatWouldBreakWhatTheyBecome) {
    const std::string folder = Folder("v/docs");
    std::vector<std::string> names = {
        "",      ".docs",  "@docs@",      "global",   "GLOBAL",       " docs",
        "docs ", "do  cs", "zel_command", "\xc0\xaf", "\xed\xa0\x80", "\xe2\x82"};
    for (const char forbidden : std::string("/:\"]\\[*?\n\t\x7f\xff")) {
        names.push_back(std::string("docs") + forbidden);
    }
    names.emplace_back(81, 'n');
    for (const std::string& name : names) {
        EXPECT_EQ(Add(name, folder), TARQ_ERR_BAD_PARAMETER) << name;
    }
    EXPECT_EQ(Add(std::string(80, 'n'), folder), 0);
}

TEST_F(Catalogue, RefusesFoldersThatAreNotThereOrAreTaken) {
    root_.Write("v/file", "");
    EXPECT_EQ(Add("a", "v/docs"), TARQ_ERR_BAD_PARAMETER);
    EXPECT_EQ(Add("a", "/"), TARQ_ERR_BAD_PARAMETER);
    EXPECT_EQ(Add("a", root_.Path("v/file")), TARQ_ERR_SHARE_FOLDER);
    ASSERT_EQ(Add("a", Folder("v/docs")), 0);
    EXPECT_EQ(Add("A", Folder("v/other")), TARQ_ERR_SHARE_EXISTS);
    fs::create_directory_symlink(root_.Path("v/docs"), root_.Path("v/link"));
    for (const char* taken : {"v/docs", "v/docs/inner", "v", "v/link"}) {
        EXPECT_EQ(Add("b", Folder(taken)), TARQ_ERR_SHARE_OVERLAP) << taken;
    }
    EXPECT_EQ(Add("b", Folder("v/docs2")), 0);
}

TEST_F(Catalogue, ReadsSectionsThatPeopleWrote) {
    const std::string path = "path=\"" + Folder("v/docs") + "\"\n";
    const auto read = [&](const std::string& section) {
        WriteCatalogue("[docs]\n" + section + "\n");
        return ErrorOfGet("docs");
    };
    EXPECT_EQ(read(path + "flags=\"acl, 0x800|32768\"\nkey_length=\"256\""), 0);
    EXPECT_EQ(Get("docs")->flags, TARQ_SHARE_ACL | TARQ_SHARE_WINDOWS | TARQ_SHARE_CLUSTER);
    EXPECT_EQ(Get("docs")->enc_key_len, 256);
    EXPECT_EQ(read("flags=\"\""), 0);
    EXPECT_EQ(Get("docs")->path, nullptr);
    for (const char* bad : {"flags=\"encrpyted\"", "key_length=\"-1\"", "flags=\"0x1ffffffff\""}) {
        EXPECT_EQ(read(path + bad), TARQ_ERR_BAD_PARAMETER) << bad;
    }
    EXPECT_EQ(read("path=\"docs\""), TARQ_ERR_BAD_PARAMETER);
    EXPECT_EQ(read(path + "volume=\"/nowhere/mounted\""), TARQ_ERR_SHARE_VOLUME);
    EXPECT_EQ(read("path=\"" + root_.Path("v/gone") + "\""), TARQ_ERR_SHARE_FOLDER);
}

TEST_F(Catalogue, EncryptedShareIsWhereItsStorageIs) {
    const std::string docs = Folder("v/docs");
    constexpr unsigned int kFlags = TARQ_SHARE_ENCRYPTED | TARQ_SHARE_AUTO_MOUNT;
    EXPECT_EQ(Add("docs", docs, kFlags), TARQ_ERR_SHARE_FOLDER);
    const std::string storage = Folder("v/@docs@");
    ASSERT_EQ(Add("docs", docs, kFlags), 0);
    ASSERT_EQ(Add("plain", Folder("v/plain"), TARQ_SHARE_AUTO_MOUNT), 0);
    EXPECT_EQ(Add("inside", storage), TARQ_ERR_SHARE_OVERLAP);
    fs::remove(docs);  // a closed share shows no folder, and travels all the same
    const auto share = Get("docs");
    ASSERT_TRUE(share);

    char buffer[4096];
    EXPECT_LT(KAPIShareEncryptPathGet(docs.c_str(), buffer, static_cast<int>(storage.size())), 0);
    EXPECT_EQ(ErrorOf(KAPIShareEncryptPathGet(root_.Path("v/plain").c_str(), buffer, 4095)),
              TARQ_ERR_NO_SHARE);
    const auto places = [&] {
        std::string text;
        EXPECT_EQ(KAPIShareEncryptPathGet(docs.c_str(), buffer, 4095), 0);
        text += buffer;
        EXPECT_EQ(TARQShareEncAutoKeyFileGet(share.get(), buffer, sizeof buffer), 0);
        text += std::string(" ") + buffer;
        EXPECT_EQ(TARQShareEncKeyFileGet(share.get(), buffer, sizeof buffer), 0);
        return text + " " + buffer;
    };
    const std::string keys = root_.Path("usr/tarq/etc/.encrypt/");
    EXPECT_EQ(places(), storage + " " + keys + "docs " + keys + "@docs");
    for (const std::string name : {"docs", "plain"}) {
        int automatic = -1;
        EXPECT_EQ(KAPIShareIsAutoDecryptGet(Get(name).get(), &automatic), 0);
        EXPECT_EQ(automatic, name == "docs") << name;
    }

    fs::remove(storage);
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_FOLDER);
    WriteCatalogue("[docs]\npath=\"" + docs + "\"\nflags=\"encrypted\"\nencrypted_path=\"" +
                   Folder("v/vault") + "\"\nkey_file=\"/k/exported\"\nauto_key_file=\"/k/auto\"\n");
    EXPECT_EQ(places(), root_.Path("v/vault") + " /k/auto /k/exported");
}

TEST_F(Catalogue, AnotherFolderInThePlaceOfTheSharesWaitsForAPerson) {
    constexpr char kCatalogue[] = "usr/tarq/etc/tarqshare.conf";
    const std::string docs = Folder("v/docs");
    const auto replace_folder = [&](const char* aside) {
        fs::rename(docs, root_.Path(aside));
        Folder("v/docs");
        return ErrorOfGet("docs");
    };
    ASSERT_EQ(Add("docs", docs), 0);
    EXPECT_EQ(replace_folder("v/first"), TARQ_ERR_SHARE_IDENTITY);
    const TARQ::HashOwner was(KAPICSzHashAlloc(0));
    const TARQ::HashOwner seen(KAPICSzHashAlloc(0));
    EXPECT_EQ(TARQShareFactsGet("docs", was.get(), seen.get()), 0);
    EXPECT_EQ(replace_folder("v/second"), TARQ_ERR_SHARE_IDENTITY);
    EXPECT_EQ(ErrorOf(TARQShareConfirm("docs", seen.get())), TARQ_ERR_SHARE_IDENTITY)
        << "what was shown has changed since";
    EXPECT_EQ(TARQShareFactsGet("docs", was.get(), seen.get()), 0);
    EXPECT_EQ(ErrorOf(TARQShareConfirm("docs", seen.get())), 0);
    EXPECT_EQ(TARQShareFactsGet("docs", was.get(), seen.get()), 1);
    EXPECT_EQ(ErrorOfGet("docs"), 0);

    // A catalogue of the time before identities: the first look-up records, and the next one knows.
    const std::string text = test::ReadFile(root_.Path(kCatalogue));
    WriteCatalogue("# mine\n[docs]\npath=\"" + docs + "\"\n");
    EXPECT_EQ(ErrorOfGet("docs"), 0);
    EXPECT_THAT(test::ReadFile(root_.Path(kCatalogue)), testing::StartsWith("# mine\n"));
    for (const char* key : {"folder_inode", "volume"}) {
        const auto line = text.substr(text.find(std::string(key) + "="));
        EXPECT_THAT(test::ReadFile(root_.Path(kCatalogue)),
                    testing::HasSubstr(line.substr(0, line.find('\n'))));
    }
    EXPECT_EQ(replace_folder("v/third"), TARQ_ERR_SHARE_IDENTITY);
}

TEST_F(Catalogue, WritersDoNotLoseEachOthersShares) {
    std::vector<std::thread> writers;
    for (const char* writer : {"a", "b", "c", "d"}) {
        writers.emplace_back([this, writer] {
            for (int i = 0; i < 6; ++i) {
                const std::string name = writer + std::to_string(i);
                EXPECT_EQ(Add(name, Folder("v/" + name)), 0);
            }
        });
    }
    for (std::thread& writer : writers) {
        writer.join();
    }
    EXPECT_EQ(Names().size(), 4 * 6 * 3U);
}

TEST_F(Catalogue, EmptyMountPointIsNeverAnEmptiedShare) {
    if (unshare(CLONE_NEWNS) != 0 ||
        mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
        GTEST_SKIP() << "mounts of one's own need root";
    }
    const auto mount_at = [](const std::string& point, const char* type) {
        ASSERT_EQ(mount("none", point.c_str(), type, 0, nullptr), 0);
    };
    const std::string volume = Folder("my volume");
    mount_at(volume, "tmpfs");
    ASSERT_EQ(Add("docs", Folder("my volume/docs")), 0);
    EXPECT_EQ(ErrorOfGet("docs"), 0);
    fs::remove(root_.Path("my volume/docs"));
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_FOLDER);
    ASSERT_EQ(umount(volume.c_str()), 0);
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME);
    Folder("my volume/docs");
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME);
    mount_at(volume, "ramfs");
    Folder("my volume/docs");
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME) << "a file system of another kind";
    ASSERT_EQ(umount(volume.c_str()), 0);
    mount_at(volume, "tmpfs");
    Folder("my volume/docs");
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_IDENTITY) << "another disk of the same kind";
    ASSERT_EQ(umount(volume.c_str()), 0);

    // What a mount hides is not there, however well its mount point fits the path.
    TARQVolumePath found{};
    mount_at(Folder("my volume/deep"), "tmpfs");
    mount_at(volume, "tmpfs");
    EXPECT_EQ(VolumePathParseEx(Folder("my volume/deep").c_str(), &found), 0);
    EXPECT_EQ(found.path, volume);
    EXPECT_EQ(ErrorOf(VolumePathParseEx(root_.Path("none").c_str(), &found)), TARQ_ERR_NO_VOLUME);

    // Another volume over the share's own folder hides its files just as well.
    mount_at(Folder("my volume/docs"), "tmpfs");
    EXPECT_EQ(ErrorOfGet("docs"), TARQ_ERR_SHARE_VOLUME);
    umount2(volume.c_str(), MNT_DETACH);
    umount(root_.Path("my volume/deep").c_str());
}

}  // namespace
