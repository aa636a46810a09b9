#include "programs/zel_server/take_storage.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <set>

#include "base/make_folder.h"
#include "base/unique_fd.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zel_server/health.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/storage.h"
#include "programs/zel_server/version_store.h"
#include "tarq/core.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;
using programs::Failure;
using programs::FailureKind;
using programs::SystemFailure;

constexpr mode_t kClosed = 0700;

std::string Quoted(const std::string& text) {
    return "'" + programs::Printable(text) + "'";
}

bool IsInMemory(const std::string& folder) {
    constexpr uint32_t kTmpfs = 0x01021994;
    constexpr uint32_t kRamfs = 0x858458f6;
    struct statfs info = {};
    if (statfs(folder.c_str(), &info) != 0) {
        return false;
    }
    const auto type = static_cast<uint32_t>(info.f_type);
    return type == kTmpfs || type == kRamfs;
}

// ---- Contents of a folder ----

// The names in a storage folder, without what the file system itself creates.
std::vector<std::string> NamesIn(const std::string& folder) {
    std::vector<std::string> names;
    std::error_code error;
    fs::directory_iterator entry(folder, error);
    for (; !error && entry != fs::directory_iterator(); entry.increment(error)) {
        if (entry->path().filename() != "lost+found") {
            names.push_back(entry->path().filename());
        }
    }
    if (error) {
        throw Failure("cannot look into the storage folder " + folder + ": " + error.message());
    }
    std::sort(names.begin(), names.end());
    return names;
}

// Existing subfolders of a storage folder that could be copies of shares.
std::vector<std::string> CopiesIn(const std::string& storage) {
    std::vector<std::string> copies;
    for (const std::string& name : NamesIn(storage)) {
        std::error_code gone;
        std::string path = storage + "/";
        path += name;
        if (fs::is_directory(fs::symlink_status(path, gone)) &&
            (IsShareName(name) || IsShareName(ShareOfModule(name)))) {
            copies.push_back(path);
        }
    }
    return copies;
}

// A share and what the registry says of it.
struct KnownShare {
    std::string name;
    ShareState state;
};

// All shares that have a copy.
std::vector<KnownShare> SharesWithCopy() {
    std::vector<KnownShare> shares;
    for (const std::string& name : KnownShares().value_or(std::vector<std::string>())) {
        ShareState state;
        if (ReadShare(name, state) == ReadResult::kRead && !state.path.empty()) {
            shares.push_back({name, state});
        }
    }
    return shares;
}

// The names in a folder that are not copies of this server: neither recorded as such, nor owned by
// the dedicated user of the copies.
std::vector<std::string> OtherThingsIn(const ServerConfig& config, const std::string& folder) {
    std::set<std::string> copies = {VersionsBelow(folder)};
    for (const KnownShare& share : SharesWithCopy()) {
        copies.insert(share.state.path);
    }
    const auto owner = OwnerOfCopies(config);
    std::vector<std::string> others;
    for (const std::string& name : NamesIn(folder)) {
        std::string path = folder + "/";
        path += name;
        struct stat info = {};
        const bool of_copies_user = !config.user.empty() && owner && owner->uid != 0 &&
                                    lstat(path.c_str(), &info) == 0 && info.st_uid == owner->uid;
        if (!of_copies_user && copies.count(path) == 0) {
            others.push_back(name);
        }
    }
    return others;
}

// ---- A storage folder ----

[[noreturn]] void RefuseFolder(const std::string& folder, const std::string& why) {
    throw Failure("the storage folder cannot be " + folder + ": " + why);
}

void CloseFolder(const ServerConfig& config, const std::string& folder) {
    if (WhyOpen(config, folder).empty()) {
        return;
    }
    const std::string above = WhyReplaceable(config, folder);
    if (!above.empty()) {
        RefuseFolder(folder, above +
                                 ", so that others could put another in its place; choose one "
                                 "that only root can change on the way");
    }
    const base::UniqueFd opened(
        open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!opened) {
        RefuseFolder(folder, errno == ELOOP || errno == ENOTDIR
                                 ? "it is a symbolic link or a file; name the folder itself"
                                 : strerror(errno));
    }
    const auto owner = OwnerOfCopies(config);
    const std::vector<std::string> others = OtherThingsIn(config, folder);
    if (!others.empty()) {
        const std::string user = config.user.empty() ? "you" : "the user '" + config.user + "'";
        RefuseFolder(
            folder,
            "only " + user + " may get at what is in a storage folder, and this one holds " +
                Listed(others) + ", which is no copy of this server's.\nChoose one of its own, " +
                "such as --storage " + folder +
                "/copies: copies of this server's move there. Or, " +
                "when nobody else needs\nwhat is in it: " +
                (config.user.empty() ? ""
                                     : "chown " + config.user + ": " + Quoted(folder) + " && ") +
                "chmod 700 " + Quoted(folder) + ", and once more");
    }
    struct stat info = {};
    const bool same_owner = fstat(opened.Get(), &info) == 0 && info.st_uid == owner->uid;
    if ((!same_owner && fchown(opened.Get(), owner->uid, owner->gid) != 0) ||
        fchmod(opened.Get(), kClosed) != 0) {
        RefuseFolder(folder, std::string("it cannot be closed to others: ") + strerror(errno));
    }
    const std::string open_still = WhyOpen(config, folder);
    if (!open_still.empty()) {
        RefuseFolder(folder, "it cannot be closed to others: it " + open_still);
    }
}

void RequireUsable(const ServerConfig& config, const std::string& folder) {
    switch (CheckStorage(config, folder)) {
        case StorageState::kReady:
            return;
        case StorageState::kReadOnly:
            RefuseFolder(folder, "its disk is mounted read-only");
        case StorageState::kNoAttributes:
            RefuseFolder(folder,
                         "its file system keeps no user attributes, so owners, special files and "
                         "lists would be lost; --no-attributes takes it all the same");
        default:
            RefuseFolder(folder, "it is no folder, or may not be written");
    }
}

void TakeFolder(const ServerConfig& config, const std::string& folder) {
    if (!base::MakeFolder(folder, kClosed)) {
        throw SystemFailure("cannot make the storage folder '" + folder + "'");
    }
    const std::string disk = RecordDiskOf(folder);
    if (disk.empty()) {
        throw Failure("cannot tell which disk '" + folder +
                      "' is on: " + KAPICErrText(KAPICErrGet()));
    }
    CloseFolder(config, folder);
    RequireUsable(config, folder);
    printf("Storage: %s, on the disk mounted at %s\n", folder.c_str(), disk.c_str());
    if (TARQ::RootFolder().empty() && IsInMemory(folder)) {
        printf("         NOTE: that is in memory: the copies are gone when the machine starts\n");
    }
    if (!KeepsAttributes(folder)) {
        printf(
            "         NOTE: owners and special files are not kept there, nor who a program runs "
            "as\n");
    }
    const std::vector<std::string> foreign = ForeignFolders(config, CopiesIn(folder));
    if (!foreign.empty()) {
        const Problem problem = ForeignCopies(config, foreign);
        printf("         NOTE: %s\n         %s\n", problem.what.c_str(), problem.mend.c_str());
    }
}

// ---- Copies that others can access ----

bool IsCopyThere(const ServerConfig& config, const std::string& path) {
    const auto owner = OwnerOfCopies(config);
    struct stat info = {};
    return owner && lstat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode) &&
           info.st_uid == owner->uid;
}

bool IsOnOneDisk(const std::string& a, const std::string& b) {
    struct stat first = {};
    struct stat second = {};
    return stat(a.c_str(), &first) == 0 && stat(b.c_str(), &second) == 0 &&
           first.st_dev == second.st_dev;
}

// The new path of the copy, which is also found when an earlier move was interrupted after its
// rename. Empty when no storage folder is on the same disk.
std::string PlaceFor(const ServerConfig& config, const ShareState& state) {
    const std::string name = state.path.substr(state.path.rfind('/'));
    for (const std::string& folder : config.Folders()) {
        const bool moved =
            !fs::exists(fs::symlink_status(state.path)) && IsCopyThere(config, folder + name);
        if (moved || IsOnOneDisk(state.path, folder)) {
            return folder + name;
        }
    }
    return "";
}

// Moves the copy to its new path, which must be free. Others may have tampered with the old path,
// so only a folder that belongs to the user of the copies is moved.
bool Move(const ServerConfig& config, const std::string& from, const std::string& to) {
    if (IsCopyThere(config, to) && !fs::exists(fs::symlink_status(from))) {
        return true;
    }
    if (!IsCopyThere(config, from)) {
        errno = EPERM;
        return false;
    }
    if (renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE) != 0) {
        return false;
    }
    if (!IsCopyThere(config, to)) {
        static_cast<void>(rename(to.c_str(), from.c_str()));
        errno = EPERM;
        return false;
    }
    return true;
}

void MoveCopy(const ServerConfig& config, KnownShare share) {
    const std::string from = share.state.path;
    const std::string to = PlaceFor(config, share.state);
    if (to.empty() || !Move(config, from, to)) {
        printf(
            "NOTE:    the copy of %s in %s lies open to others (%s), and cannot be moved%s: "
            "nobody may push\n         there. Move it into a storage folder yourself, then "
            "'zel_server setup' again\n",
            Quoted(share.name).c_str(), from.c_str(), WhyOpen(config, FolderAbove(from)).c_str(),
            to.empty() ? ", as no storage folder is on the same disk"
                       : (" to " + to + ": " + strerror(errno)).c_str());
        return;
    }
    share.state.path = to;
    CloseShare(share.name, true);
    if (!WriteShare(share.name, share.state) ||
        !WriteShareRecord(share.name, share.state, RecordedCopy(share.name))) {
        throw SystemFailure("cannot write where the copy of " + Quoted(share.name) + " is now");
    }
    printf("Moved:   the copy of %s from %s to %s\n", Quoted(share.name).c_str(), from.c_str(),
           to.c_str());
}

}  // namespace

void TakeStorage(const ServerConfig& config) {
    for (const std::string& folder : config.Folders()) {
        TakeFolder(config, folder);
    }
}

void RequireClosedStorage(ServerConfig& config) {
    const bool never_closed = !config.closed;
    bool all_there = true;
    for (const std::string& folder : config.Folders()) {
        const StorageState state = CheckStorage(config, folder);
        all_there =
            all_there && state != StorageState::kAbsent && state != StorageState::kOtherDisk;
        if (state != StorageState::kOpen) {
            continue;
        }
        if (!never_closed) {
            throw Failure(FailureKind::kUsage, "the storage folder " + folder + " " +
                                                   WhyOpen(config, folder) +
                                                   ", so others could get at the copies: "
                                                   "'zel_server setup' closes it, or says what to "
                                                   "do");
        }
        try {
            CloseFolder(config, folder);
        } catch (const Failure& failure) {
            throw Failure(FailureKind::kUsage, failure.what());
        }
    }
    config.closed = config.closed || all_there;
    if (never_closed && config.closed && !SaveServerConfig(config)) {
        throw SystemFailure("cannot write " + ConfigFile());
    }
}

void MoveOpenCopies(const ServerConfig& config) {
    for (const KnownShare& share : SharesWithCopy()) {
        const std::string folder = FolderAbove(share.state.path);
        const StorageState state = CheckStorage(config, folder);
        // A folder that was once a storage folder and contains nothing but copies is closed in
        // place.
        if (state == StorageState::kOpen && OtherThingsIn(config, folder).empty() &&
            WhyReplaceable(config, folder).empty()) {
            CloseFolder(config, folder);
        } else if (state == StorageState::kOpen) {
            MoveCopy(config, share);
        }
    }
}

}  // namespace zel_server
