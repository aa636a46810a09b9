// What the three sources of the pairing registry share: owners of the platform's handles, names,
// the lock.
#pragma once

#include <memory>
#include <string>
#include <utility>

#include "tarq/owners.h"

namespace ZEL::registry {

inline constexpr const char* kPairSection = "PairedClientInfo";
inline constexpr const char* kEnabledKey = "zelEnabled";
inline constexpr const char* kClientKey = "clientID";
inline constexpr const char* kServerKey = "serverName";
inline constexpr const char* kRunningKey = "RunningID";
inline constexpr const char* kCompleteKey = "CompleteID";
inline constexpr const char* kOwnServerKey = "ServerName";  // of a client's own section
inline constexpr const char* kMultiSource = "ZELMULTI-SRC-SUPPORT";
inline constexpr const char* kShareFormat = "SHARE_%s";
inline constexpr const char* kClientFormat = "CLIENTID_%s";

inline constexpr int kEntries = 1024;  // capacity of the hashes and lists

using Hash = TARQ::HashOwner;
using List = TARQ::ListOwner;
using Text = TARQ::TextOwner;

inline Hash MakeHash(int capacity = kEntries) {
    return Hash(KAPICSzHashAlloc(capacity));
}
inline List MakeList() {
    return List(KAPICSzListAlloc(kEntries));
}
inline Text Format(const char* format, const char* argument) {
    return Text(KAPICStrGet(format, argument));
}

inline bool IsEmpty(const char* text) {
    return text == nullptr || *text == '\0';
}

/// How many bytes of a share's name are compared when letter case is ignored.
inline constexpr int kNameCharacters = 32;

/// Holds the semaphore that all writers of the registry take.
class WriteLock {
public:
    WriteLock();
    ~WriteLock();
    WriteLock(const WriteLock&) = delete;
    WriteLock& operator=(const WriteLock&) = delete;
    /// Whether it is held.
    explicit operator bool() const { return locked_; }

private:
    int id_;
    bool locked_;
};

/// Where the registry lies. Empty, a path that every operation refuses, when there is no memory for
/// it.
std::string RegistryPath() noexcept;

/// PairedClientInfo in a hash of its own; null when it cannot be read. Without the section the hash
/// is empty.
Hash ReadPairing();

/// Sets keys of PairedClientInfo and keeps its others. 0 or -1.
int MergePairing(KAPICSzHash values);

/// Sets both "clientID" and "serverName". False when that fails.
bool SetPair(KAPICSzHash pairing, const char* client, const char* server);

}  // namespace ZEL::registry
