// Shares and volumes: the first part of zel.h.
#include <string.h>

#include <memory>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "tarq/core.h"
#include "tarq/owners.h"

namespace ZEL {

namespace {

constexpr size_t kEncryptPathSize = 4095;

using ShareRecord = TARQ::ShareOwner;

// Null when there is no such share. A name with a NUL in it matches none: the platform would see
// only the part before the NUL.
ShareRecord FindShare(const std::string& name) {
    TARQShare share = nullptr;
    const bool found =
        name.find('\0') == std::string::npos && TARQShareGet(name.c_str(), &share) == 0;
    ShareRecord record(share);
    return found ? std::move(record) : nullptr;
}

}  // namespace

bool ShareInfo::IsEncrypted() const {
    return (flags_ & TARQ_SHARE_ENCRYPTED) != 0;
}

bool ShareInfo::IsAutoMount() const {
    return (flags_ & TARQ_SHARE_AUTO_MOUNT) != 0;
}

bool ShareInfo::IsWinShare() const {
    return (flags_ & TARQ_SHARE_WINDOWS) != 0;
}

bool ShareInfo::IsCluster() const {
    return (flags_ & TARQ_SHARE_CLUSTER) != 0;
}

bool ShareInfo::IsACL() const {
    return (flags_ & TARQ_SHARE_ACL) != 0 || IsWinShare();
}

bool VolumeInfo::IsInternal() const {
    return type_ == TARQ_VOLUME_INTERNAL;
}

int GetShareInfo(const std::string& name, ShareInfo& out) {
    if (name.empty()) {
        return -1;
    }
    const ShareRecord record = FindShare(name);
    if (!record) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/zel(%d): Fail to get share '%s'\n",
                       __LINE__, name.c_str());
        return -1;
    }
    if (record->path == nullptr) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/zel(%d): Fail to get the path of share '%s'\n", __LINE__,
                       name.c_str());
        return -1;
    }
    if ((record->flags & TARQ_SHARE_ENCRYPTED) != 0) {
        char storage[kEncryptPathSize] = "";
        if (KAPIShareEncryptPathGet(record->path, storage, sizeof storage) < 0) {
            Logger::LogMsg(Logger::LEVEL_ERROR,
                           "[ERROR] ZEL/zel(%d): Fail to get encrypted path of share '%s'\n",
                           __LINE__, name.c_str());
            return -1;
        }
        out.module_path_.assign(storage, strnlen(storage, sizeof storage));
        out.module_name_ = "@" + name + "@";
    } else {
        out.module_path_ = record->path;
        out.module_name_ = name;
    }
    out.name_ = name;
    out.path_ = record->path;
    out.encrypt_key_len_ = record->enc_key_len;
    out.flags_ = record->flags;
    return 0;
}

int GetVolumeInfo(const std::string& share_name, VolumeInfo& out) {
    ShareInfo share;
    if (GetShareInfo(share_name, share) < 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/zel(%d): Fail to get share info\n",
                       __LINE__);
        return -1;
    }
    TARQVolumePath volume = {};
    if (VolumePathParseEx(share.GetPath().c_str(), &volume) != 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/zel(%d): Fail to get volume info of share '%s'\n", __LINE__,
                       share_name.c_str());
        return -1;
    }
    // A path that fills its field has no terminator.
    out.path_.assign(volume.path, strnlen(volume.path, sizeof volume.path));
    out.type_ = volume.type;
    return 0;
}

int IsValidShare(const std::string& share_name, bool& result) {
    if (KAPICIsMiniUnit() != 0) {
        result = TARQShareIsInSharebin(share_name.c_str()) == 1;
        return 0;
    }
    VolumeInfo volume;
    if (GetVolumeInfo(share_name, volume) < 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/zel(%d): Fail to get volume info\n",
                       __LINE__);
        return -1;
    }
    result = volume.IsInternal();
    return 0;
}

}  // namespace ZEL
