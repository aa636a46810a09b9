// What the server reports of itself, and the change from a single pairing to a multi-source one.
#include <stdlib.h>
#include <string.h>
#include <syslog.h>
#include <time.h>

#include <cstdint>

#include "ZEL/internal/registry.h"
#include "ZEL/is_syncedshare.h"
#include "tarq/root_path.h"

using namespace ZEL::registry;

namespace {

constexpr const char* kRsyncPidFile = "/var/run/rsyncd.pid";
constexpr const char* kTaskPrefix = "TASK_";
constexpr size_t kTaskPrefixLength = 5;
constexpr const char* kStatusKey = "status";
constexpr const char* kIdle = "idle";
constexpr int32_t kBusySeconds = 120;  // a running task reports about every minute

bool IsRsyncAlive() {
    try {
        return KAPICProcAliveByPidFile(TARQ::RootPath(kRsyncPidFile).c_str()) != 0;
    } catch (...) {
        return false;
    }
}

bool IsEnabled() {
    const Hash pairing = ReadPairing();
    const char* enabled =
        pairing != nullptr ? KAPICSzHashGetValue(pairing.get(), kEnabledKey) : nullptr;
    return enabled != nullptr && strcmp(enabled, "yes") == 0 && IsRsyncAlive();
}

char* CopyOf(KAPICSzHash hash, const char* key) {
    const char* value = KAPICSzHashGetValue(hash, key);
    return value != nullptr ? KAPICStrGet("%s", value) : nullptr;
}

/// Whether a task's status is a time less than two minutes ago. Both are taken modulo 2^32, so that
/// the difference is right for 32-bit and 64-bit time_t.
bool IsRecent(const char* status) {
    const auto then = static_cast<uint32_t>(strtoll(status, nullptr, 10));
    const auto age = static_cast<int32_t>(static_cast<uint32_t>(time(nullptr)) - then);
    return age < kBusySeconds;
}

bool IsAnyTaskRunning() {
    const List sections = MakeList();
    const Hash task = MakeHash();
    if (sections == nullptr || task == nullptr ||
        KAPICFileEnumSection(RegistryPath().c_str(), sections.get()) < 0) {
        return false;
    }
    const int count = KAPICSzListCount(sections.get());
    for (int i = 0; i < count; ++i) {
        const char* section = KAPICSzListGet(sections.get(), i);
        if (strncmp(section, kTaskPrefix, kTaskPrefixLength) != 0) {
            continue;
        }
        KAPICHashRemoveAll(task.get());
        if (ZELGetServerInfo(section, task.get()) < 0) {
            return false;
        }
        const char* status = KAPICSzHashGetValue(task.get(), kStatusKey);
        if (status != nullptr && strcmp(status, kIdle) != 0 && IsRecent(status)) {
            return true;
        }
    }
    return false;
}

/// Gives the single client of `pairing` a section of its own.
void AddClientSection(KAPICSzHash pairing) {
    const Hash values = MakeHash();
    if (ZELCheckServerInfo() != 0 || values == nullptr) {
        return;
    }
    const char* client = KAPICSzHashGetValue(pairing, kClientKey);
    if (client == nullptr) {
        syslog(LOG_ERR, "Failed to get clientID from hash.");
        return;
    }
    const char* server = KAPICSzHashGetValue(pairing, kServerKey);
    if (server == nullptr) {
        syslog(LOG_ERR, "Failed to get serverName from hash.");
        return;
    }
    if (KAPICSzHashSetValue(values.get(), kOwnServerKey, server) < 0) {
        return;
    }
    const Text section = Format(kClientFormat, client);
    const WriteLock lock;
    if (section == nullptr || !lock) {
        return;
    }
    const std::string path = RegistryPath();
    if (KAPICFileAddSection(path.c_str(), section.get(), values.get(), nullptr) < 0) {
        syslog(LOG_ERR, "Failed to add section [%s].", section.get());
    }
}

}  // namespace

int zel_svr_get_status(zel_svr_status* status) {
    if (status == nullptr) {
        return -1;
    }
    *status = {IsEnabled() ? 1 : 0, 0, nullptr, nullptr};
    {
        const Hash pairing = ReadPairing();
        if (pairing == nullptr) {
            return -1;
        }
        status->client_id = CopyOf(pairing.get(), kClientKey);
        status->server_name = CopyOf(pairing.get(), kServerKey);
    }
    status->busy = IsAnyTaskRunning() ? 1 : 0;
    return 0;
}

int zel_svr_put_status(zel_svr_status* status) {
    if (status != nullptr) {
        KAPICStrPut(status->client_id);
        KAPICStrPut(status->server_name);
    }
    return 0;
}

int zel_svr_reset_pair(void) {
    const Hash pairing = ReadPairing();
    if (pairing == nullptr) {
        return -1;
    }
    AddClientSection(pairing.get());
    // The merge keeps the keys that it is not given.
    KAPICHashRemoveAll(pairing.get());
    if (!SetPair(pairing.get(), kMultiSource, kMultiSource)) {
        return -1;
    }
    return MergePairing(pairing.get());
}
