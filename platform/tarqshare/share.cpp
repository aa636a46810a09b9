#include <tarq/share.h>

#include <fcntl.h>
#include <strings.h>
#include <sys/stat.h>
#include <tarq/owners.h>
#include <unistd.h>

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

using base::UniqueFd;
using tarq_internal::CopyOut;
using tarq_internal::Fail;
using tarq_internal::Guarded;
using tarq_share::FindVolume;
using tarq_share::IsWithin;
using tarq_share::ReadShare;
using tarq_share::ReadShareNames;
using tarq_share::Share;
using tarq_share::Volume;

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

/// 0 when the share's files are where they were when it was added.
int CheckData(const Share& share) {
    const std::string& folder = share.DataFolder();
    if (folder.empty()) {
        return 0;
    }
    struct stat status {};
    const bool there = stat(folder.c_str(), &status) == 0;
    const int reason = there ? ENOTDIR : errno;
    if (!share.volume.mount_point.empty()) {
        const std::optional<Volume> now = FindVolume(there ? folder : share.volume.mount_point);
        if (!now || !IsSameVolume(share.volume, *now)) {
            return Fail(TARQ_ERR_SHARE_VOLUME);
        }
    }
    if (!there || !S_ISDIR(status.st_mode)) {
        errno = reason;
        return Fail(TARQ_ERR_SHARE_FOLDER);
    }
    return 0;
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
        const std::optional<Volume> volume = FindVolume(share.DataFolder());
        if (!volume) {
            return Fail(TARQ_ERR_NO_VOLUME);
        }
        share.volume = *volume;

        const tarq_share::CatalogueLock lock;
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
        const tarq_share::CatalogueLock lock;
        return lock && tarq_share::EraseShare(name) ? 0 : -1;
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
