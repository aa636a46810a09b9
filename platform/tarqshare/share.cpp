#include <tarq/share.h>

#include <fcntl.h>
#include <strings.h>
#include <tarq/owners.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <string>

#include "base/unique_fd.h"
#include "platform/internal/config.h"
#include "platform/internal/error.h"
#include "platform/tarqshare/catalogue.h"
#include "platform/tarqshare/mount_table.h"
#include "platform/tarqshare/volume.h"

static_assert(sizeof(TARQVolumePath) == 132, "callers know the record by its size");

namespace {

using base::FolderIdentity;
using base::IdentityOf;
using base::UniqueFd;
using tarq_internal::CopyOut;
using tarq_internal::Fail;
using tarq_internal::Guarded;
using tarq_share::AddFacts;
using tarq_share::CatalogueLock;
using tarq_share::FactsOf;
using tarq_share::FindVolume;
using tarq_share::IsWithin;
using tarq_share::ReadShare;
using tarq_share::ReadShareNames;
using tarq_share::Share;
using tarq_share::Volume;
using tarq_share::WriteFacts;

// Beside what the catalogue has of it: the folder whose files travel.
constexpr char kPathFact[] = "path";

int Answer(const std::string& text, char* buffer, int size) {
    return CopyOut(text, buffer, size) ? 0 : Fail(TARQ_ERR_BAD_PARAMETER);
}

/// The path without links; nothing, with errno set, when it is no folder that can be read.
std::optional<std::string> ReadableFolder(const std::string& path) {
    const UniqueFd folder(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::array<char, PATH_MAX> real;
    if (!folder || realpath(path.c_str(), real.data()) == nullptr) {
        return std::nullopt;
    }
    return real.data();
}

UniqueFd OpenFolder(const std::string& path) {
    return UniqueFd(open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
}

/// Puts the volume and the identity of the share's folder as it is now into `share`. 0, or -1.
int LookAt(Share* share) {
    const std::string& path = share->DataFolder();
    const UniqueFd folder = OpenFolder(path);
    const std::optional<FolderIdentity> identity = folder ? IdentityOf(folder.Get()) : std::nullopt;
    if (!identity) {
        return Fail(TARQ_ERR_SHARE_FOLDER);
    }
    const std::optional<Volume> volume = FindVolume(path);
    if (!volume) {
        return Fail(TARQ_ERR_NO_VOLUME);
    }
    share->volume = *volume;
    share->identity = *identity;
    return 0;
}

bool HasFact(KAPICSzHash seen, const char* key, const std::string& value) {
    const char* const known = KAPICSzHashGetValue(seen, key);
    return known != nullptr && value == known;
}

bool HasFacts(KAPICSzHash seen, const Share& share) {
    const auto facts = FactsOf(share);
    return std::all_of(facts.begin(), facts.end(),
                       [seen](const auto& fact) { return HasFact(seen, fact.first, fact.second); });
}

/// Whether the share, as the catalogue has it, was where `now` says that it is.
bool IsSamePlace(const Share& recorded, const Share& now) {
    return (recorded.volume.mount_point.empty() || IsSameVolume(recorded.volume, now.volume)) &&
           IsSameIdentity(recorded.identity, now.identity);
}

/// Records where the folder is now for a share that has no identity: it was added before identities
/// were kept, or written by hand. What cannot be written now, or not by this caller, is the next
/// one's to write: no failure.
void AdoptIdentity(const std::string& name) {
    const int error_before = KAPICErrGet();
    const CatalogueLock lock(CatalogueLock::Patience::kNone);
    const std::optional<Share> recorded = lock ? ReadShare(name) : std::nullopt;
    if (recorded && recorded->identity.file_system.empty()) {
        Share now = *recorded;
        if (LookAt(&now) == 0 && IsSamePlace(*recorded, now)) {
            if (now.volume.uuid.empty()) {
                now.volume.uuid = recorded->volume.uuid;
            }
            WriteFacts(now);
        }
    }
    KAPICErrSetEx(error_before, __FILE__, __LINE__);
}

/// 0 when the share's files are where they were when it was added.
int CheckData(const Share& share) {
    const std::string& path = share.DataFolder();
    if (path.empty()) {
        return 0;
    }
    const UniqueFd folder = OpenFolder(path);
    const int reason = errno;
    if (!share.volume.mount_point.empty()) {
        const std::optional<Volume> now = FindVolume(folder ? path : share.volume.mount_point);
        if (!now || !IsSameVolume(share.volume, *now)) {
            return Fail(TARQ_ERR_SHARE_VOLUME);
        }
    }
    if (!folder) {
        errno = reason;
        return Fail(TARQ_ERR_SHARE_FOLDER);
    }
    const std::optional<FolderIdentity> now = IdentityOf(folder.Get());
    if (!now) {
        return Fail(TARQ_ERR_SHARE_FOLDER);
    }
    if (share.identity.file_system.empty()) {
        AdoptIdentity(share.name);
        return 0;
    }
    return IsSameIdentity(share.identity, *now) ? 0 : Fail(TARQ_ERR_SHARE_IDENTITY);
}

bool Overlap(const std::string& a, const std::string& b) {
    return !a.empty() && !b.empty() && (IsWithin(a, b) || IsWithin(b, a));
}

/// 0 when the catalogue has room for `added`: nobody has its name, even in other capitals, nor any
/// of its folders.
int CheckAgainstOthers(const Share& added) {
    const auto names = ReadShareNames();
    if (!names) {
        return -1;
    }
    for (const std::string& name : *names) {
        if (strcasecmp(name.c_str(), added.name.c_str()) == 0) {
            return Fail(TARQ_ERR_SHARE_EXISTS);
        }
    }
    for (const std::string& name : *names) {
        // A section that cannot be understood is its own share's matter.
        const std::optional<Share> other = ReadShare(name);
        if (!other) {
            continue;
        }
        for (const std::string* mine : {&added.path, &added.encrypted_path}) {
            if (Overlap(*mine, other->path) || Overlap(*mine, other->encrypted_path)) {
                return Fail(TARQ_ERR_SHARE_OVERLAP);
            }
        }
    }
    return 0;
}

int KeyFile(TARQShare share, std::string Share::*file, char* buffer, int size) {
    return Guarded(-1, [&] {
        if (share == nullptr || share->name == nullptr) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const std::optional<Share> found = ReadShare(share->name);
        return found ? Answer(*found.*file, buffer, size) : -1;
    });
}

}  // namespace

int TARQShareGet(const char* name, TARQShare* share) {
    return Guarded(-1, [&] {
        if (share == nullptr) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        *share = nullptr;
        if (name == nullptr || *name == '\0') {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const std::optional<Share> found = ReadShare(name);
        if (!found || CheckData(*found) < 0) {
            return -1;
        }
        TARQ::ShareOwner record(new (std::nothrow) TARQShareRec{});
        if (record) {
            record->name = strdup(found->name.c_str());
            record->path = found->path.empty() ? nullptr : strdup(found->path.c_str());
            record->flags = found->flags;
            record->enc_key_len = found->key_length;
        }
        if (!record || record->name == nullptr ||
            (record->path == nullptr && !found->path.empty())) {
            return Fail(TARQ_ERR_NO_MEMORY);
        }
        *share = record.release();
        return 0;
    });
}

void TARQShareFree(TARQShare share) {
    if (share != nullptr) {
        free(share->name);
        free(share->path);
        delete share;
    }
}

int TARQShareAdd(const char* name, const char* path, unsigned int flags) {
    return Guarded(-1, [&] {
        Share share;
        share.name = name == nullptr ? "" : name;
        share.flags = flags;
        if (!tarq_share::IsShareName(share.name) || path == nullptr || path[0] != '/') {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const std::optional<std::string> folder = ReadableFolder(path);
        if (!folder) {
            return Fail(TARQ_ERR_SHARE_FOLDER);
        }
        share.path = *folder;
        if (share.path == "/") {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        if (share.IsEncrypted()) {
            share.encrypted_path = tarq_share::DefaultEncryptedPath(share.path);
            if (!ReadableFolder(share.encrypted_path)) {
                return Fail(TARQ_ERR_SHARE_FOLDER);
            }
        }
        if (LookAt(&share) < 0) {
            return -1;
        }
        const CatalogueLock lock;
        if (!lock || CheckAgainstOthers(share) < 0) {
            return -1;
        }
        return tarq_share::WriteShare(share) ? 0 : -1;
    });
}

int TARQShareRemove(const char* name) {
    return Guarded(-1, [&] {
        if (name == nullptr || *name == '\0') {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const CatalogueLock lock;
        return lock && tarq_share::EraseShare(name) ? 0 : -1;
    });
}

int TARQShareFactsGet(const char* name, KAPICSzHash recorded, KAPICSzHash now) {
    return Guarded(-1, [&] {
        if (name == nullptr || *name == '\0' || recorded == nullptr || now == nullptr) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const std::optional<Share> share = ReadShare(name);
        if (!share) {
            return -1;
        }
        Share present = *share;
        if (LookAt(&present) < 0 || !AddFacts(*share, recorded) || !AddFacts(present, now) ||
            KAPICSzHashSetValue(now, kPathFact, present.DataFolder().c_str()) < 0) {
            return -1;
        }
        return !share->identity.file_system.empty() && IsSamePlace(*share, present) ? 1 : 0;
    });
}

int TARQShareConfirm(const char* name, KAPICSzHash seen) {
    return Guarded(-1, [&] {
        if (name == nullptr || *name == '\0' || seen == nullptr) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const CatalogueLock lock;
        std::optional<Share> share = lock ? ReadShare(name) : std::nullopt;
        if (!share || LookAt(&*share) < 0) {
            return -1;
        }
        if (!HasFacts(seen, *share) || !HasFact(seen, kPathFact, share->DataFolder())) {
            return Fail(TARQ_ERR_SHARE_IDENTITY);
        }
        return WriteFacts(*share) ? 0 : -1;
    });
}

int TARQShareEnum(KAPICSzList into) {
    return Guarded(-1, [&] {
        if (into == nullptr) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const auto names = ReadShareNames();
        if (!names) {
            return -1;
        }
        for (const std::string& name : *names) {
            if (KAPICSzListPush(into, name.c_str()) < 0) {
                return -1;
            }
        }
        return 0;
    });
}

int KAPIShareEncryptPathGet(const char* share_path, char* buffer, int size) {
    return Guarded(-1, [&] {
        if (share_path == nullptr || *share_path == '\0') {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const auto names = ReadShareNames();
        if (!names) {
            return -1;
        }
        std::string path = share_path;
        while (path.size() > 1 && path.back() == '/') {
            path.pop_back();
        }
        for (const std::string& name : *names) {
            const std::optional<Share> share = ReadShare(name);
            if (share && share->path == path && !share->encrypted_path.empty()) {
                return Answer(share->encrypted_path, buffer, size);
            }
        }
        return Fail(TARQ_ERR_NO_SHARE);
    });
}

int KAPIShareIsEncryptionGet(TARQShare share, int* result) {
    if (share == nullptr || result == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    *result = (share->flags & TARQ_SHARE_ENCRYPTED) != 0 ? 1 : 0;
    return 0;
}

int KAPIShareIsAutoDecryptGet(TARQShare share, int* result) {
    constexpr unsigned int kBoth = TARQ_SHARE_ENCRYPTED | TARQ_SHARE_AUTO_MOUNT;
    if (share == nullptr || result == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    *result = (share->flags & kBoth) == kBoth ? 1 : 0;
    return 0;
}

int TARQShareEncAutoKeyFileGet(TARQShare share, char* buffer, int size) {
    return KeyFile(share, &Share::auto_key_file, buffer, size);
}

int TARQShareEncKeyFileGet(TARQShare share, char* buffer, int size) {
    return KeyFile(share, &Share::key_file, buffer, size);
}

int VolumePathParseEx(const char* path, TARQVolumePath* volume) {
    return Guarded(-1, [&] {
        if (path == nullptr || volume == nullptr) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const std::optional<Volume> found = FindVolume(path);
        TARQVolumePath answer{};
        if (!found || !CopyOut(found->mount_point, answer.path, sizeof answer.path)) {
            return Fail(TARQ_ERR_NO_VOLUME);
        }
        answer.type = found->type;
        *volume = answer;
        return 0;
    });
}

int TARQShareIsInSharebin(const char* name) {
    return Guarded(0, [&] {
        TARQShare record = nullptr;
        if (TARQShareGet(name, &record) < 0) {
            return 0;
        }
        const TARQ::ShareOwner share(record);
        TARQVolumePath volume{};
        return share->path != nullptr && VolumePathParseEx(share->path, &volume) == 0 &&
                       volume.type == TARQ_VOLUME_INTERNAL
                   ? 1
                   : 0;
    });
}
