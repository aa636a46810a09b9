// The registry file, its lock and the accessors of its sections.
#include "ZEL/is_syncedshare.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include "ZEL/internal/registry.h"
#include "base/text.h"
#include "tarq/root_path.h"

using namespace ZEL::registry;

namespace {

constexpr const char* kRegistryFile = "/usr/tarq/etc/tarqZEL.info";
constexpr int kSemaphoreKey = 0x2980298;
constexpr const char* kSourceTag = "ZEL/is_syncedshare";

constexpr const char* kTaskFormat = "TASK_%s";
constexpr const char* kLineFormat = "\t%s=\"%s\"\n";

constexpr int kUpdateEntries = 512;
constexpr int kValueSize = 256;

bool CreateFile(const std::string& path, int flags, mode_t mode) {
    const int fd = open(path.c_str(), flags | O_CREAT | O_CLOEXEC, mode);
    if (fd < 0) {
        return false;
    }
    close(fd);
    return true;
}

/// The key of the writers' semaphore; 0, which cannot be opened, when memory runs out.
int SemaphoreKey() noexcept {
    try {
        return TARQ::RootSemaphoreKey(kSemaphoreKey);
    } catch (...) {
        return 0;
    }
}

/// Appends a section to the registry, which is made when it is gone. The lock is held.
bool AppendSection(const std::string& path, const char* section, KAPICSzHash values) {
    struct stat status {};
    if (stat(path.c_str(), &status) != 0) {
        if (errno != ENOENT) {
            syslog(LOG_ERR, "Failed to stat file [%s], errno=[%d/%m]", path.c_str(), errno);
            return false;
        }
        if (!CreateFile(path, O_RDWR | O_EXCL | O_TRUNC | O_SYNC, 0777)) {
            syslog(LOG_ERR, "Failed to open file [%s], errno=[%d/%m]", path.c_str(), errno);
            return false;
        }
    }
    if (KAPICFileAddSection(path.c_str(), section, values, kLineFormat) < 1) {
        syslog(LOG_ERR, "KAPICFileAddSection() failed!! szFile=[%s], section=[%s], errno=[0x%04X]",
               path.c_str(), section, KAPICErrGet());
        return false;
    }
    return true;
}

/// Replaces the section when it exists, else appends it. The lock is held.
bool ReplaceOrAppend(const std::string& path, const char* section, KAPICSzHash values) {
    const Hash old = MakeHash(kUpdateEntries);
    if (old == nullptr) {
        return false;
    }
    if (IsEmpty(section)) {
        return AppendSection(path, section, values);
    }
    const int found = KAPICFileGetSection(path.c_str(), section, old.get());
    if (found < 0) {
        syslog(LOG_ERR, "KAPICFileGetSection error. filePath:[%s] szOldSecName:[%s]  iRet:[%d]",
               path.c_str(), section, found);
        return false;
    }
    if (found == 0) {
        return AppendSection(path, section, values);
    }
    if (KAPICFileSetSection(path.c_str(), section, 0, values, kLineFormat) < 0) {
        syslog(LOG_ERR, "KAPICFileSetSection() failed!! szFile=[%s], section=[%s], errno=[0x%04X]",
               path.c_str(), section, KAPICErrGet());
        return false;
    }
    return true;
}

/// Reads one value into a zeroed buffer; absence leaves it empty. False when the registry cannot be
/// read.
bool ReadOptional(const char* section, const char* key, char (&value)[kValueSize]) {
    if (KAPICFileGetSectionValue(RegistryPath().c_str(), section, key, value, kValueSize) >= 0) {
        return true;
    }
    const int error = KAPICErrGet();
    if (error == TARQ_ERR_NO_SECTION || error == TARQ_ERR_NO_KEY) {
        return true;
    }
    syslog(LOG_ERR, "%s:%d KAPICFileGetSectionValue error. key:[%s] errno=[0x%04X]", kSourceTag,
           __LINE__, section, error);
    return false;
}

/// Replaces the section that `format` makes of a name.
int UpdateNamed(const char* format, const char* name, KAPICSzHash values) {
    const Text section = Format(format, name);
    return section == nullptr ? -1 : ZELUpdateServerInfo(section.get(), values);
}

}  // namespace

namespace ZEL::registry {

WriteLock::WriteLock()
    : id_(KAPICSemOpen(SemaphoreKey())), locked_(id_ >= 0 && KAPICSemLock(id_) >= 0) {}

WriteLock::~WriteLock() {
    if (locked_) {
        KAPICSemUnlock(id_);
    }
    if (id_ >= 0) {
        KAPICSemClose(id_);
    }
}

std::string RegistryPath() noexcept {
    try {
        return TARQ::RootPath(kRegistryFile);
    } catch (...) {
        return {};
    }
}

Hash ReadPairing() {
    Hash pairing = MakeHash();
    if (pairing == nullptr || ZELGetServerInfo(kPairSection, pairing.get()) < 0) {
        return nullptr;
    }
    return pairing;
}

int MergePairing(KAPICSzHash values) {
    if (ZELCheckServerInfo() != 0) {
        return -1;
    }
    const WriteLock lock;
    if (!lock) {
        return -1;
    }
    const std::string path = RegistryPath();
    int result = KAPICIFileModifySection(path.c_str(), kPairSection, 0, values, 1, 0);
    if (result == 0) {
        result = KAPICFileAddSection(path.c_str(), kPairSection, values, nullptr);
    }
    return result < 0 ? -1 : 0;
}

bool SetPair(KAPICSzHash pairing, const char* client, const char* server) {
    return KAPICSzHashSetValue(pairing, kClientKey, client) >= 0 &&
           KAPICSzHashSetValue(pairing, kServerKey, server) >= 0;
}

}  // namespace ZEL::registry

int ZELCheckServerInfo(void) {
    const std::string path = RegistryPath();
    return KAPICFileExist(path.c_str()) != 0 || CreateFile(path, O_RDONLY, 0644) ? 0 : -1;
}

int ZELGetServerInfo(const char* section, KAPICSzHash into) {
    if (ZELCheckServerInfo() != 0) {
        return -1;
    }
    return KAPICFileGetSection(RegistryPath().c_str(), section, into);
}

int ZELUpdateServerInfo(const char* section, KAPICSzHash values) {
    if (section == nullptr || values == nullptr) {
        KAPICErrSetEx(TARQ_ERR_BAD_PARAMETER, kSourceTag, __LINE__);
        return -1;
    }
    ZELCheckServerInfo();
    const std::string path = RegistryPath();
    bool written = false;
    {
        const WriteLock lock;
        if (!lock) {
            syslog(LOG_ERR, "ZELUpdateServerInfo() lock failed");
            return -1;
        }
        written = ReplaceOrAppend(path, section, values);
    }
    if (!written) {
        syslog(LOG_ERR, "Set section [%s ] value into [%s] error.", section, path.c_str());
        return -1;
    }
    return 0;
}

int ZELServerGetShare(const char* share, const char* key, char* buffer, int size) {
    if (share == nullptr || key == nullptr || buffer == nullptr || size <= 0) {
        return -1;
    }
    ZELCheckServerInfo();
    const Text section = Format(kShareFormat, share);
    if (section == nullptr) {
        return -1;
    }
    return KAPICFileGetSectionValue(RegistryPath().c_str(), section.get(), key, buffer, size);
}

int ZELServerUpdateShare(const char* share, KAPICSzHash values) {
    return UpdateNamed(kShareFormat, share, values);
}

int ZELServerUpdateTask(const char* task, KAPICSzHash values) {
    return UpdateNamed(kTaskFormat, task, values);
}

int TARQUISetZEL(int enable, const char* clientID, const char* serverName) {
    const Hash pairing = ReadPairing();
    if (pairing == nullptr) {
        return -1;
    }
    // Unchanged keys are left out: another process may change them before the merge takes the lock.
    KAPICHashRemoveAll(pairing.get());
    if (clientID != nullptr && serverName != nullptr &&
        !SetPair(pairing.get(), clientID, serverName)) {
        return -1;
    }
    if (KAPICSzHashSetValue(pairing.get(), kEnabledKey, enable != 0 ? "yes" : "no") < 0) {
        return -1;
    }
    return MergePairing(pairing.get());
}

int TARQZELIsSyncedShare(const char* share) {
    if (IsEmpty(share)) {
        KAPICErrSetEx(TARQ_ERR_BAD_PARAMETER, kSourceTag, __LINE__);
        return 0;
    }
    const Text section = Format(kShareFormat, share);
    if (section == nullptr) {
        syslog(LOG_ERR, "%s:%d Fail to KAPICStrGet shareName:[%s] errno=[0x%04X]", kSourceTag,
               __LINE__, share, KAPICErrGet());
        return 0;
    }
    char enabled[kValueSize] = "";
    char running[kValueSize] = "";
    if (!ReadOptional(kPairSection, kEnabledKey, enabled) || strcmp(enabled, "no") == 0 ||
        !ReadOptional(section.get(), kRunningKey, running)) {
        return 0;
    }
    return running[0] != '\0' ? 1 : 0;
}

void getLowerString(const char* source, char* target) {
    for (int i = 0; i < kNameCharacters && source[i] != '\0'; ++i) {
        target[i] = base::Lower(source[i]);
    }
}
