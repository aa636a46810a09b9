// Where the system's fixed paths lie.
//
// Every fixed path (/usr/tarq/etc/..., /var/run/rsyncd.pid, /tmp/ZEL/...) passes through
// RootPath(), so that an unprivileged person can run a whole client and a whole server side by side
// in two folders: the folder named by the environment variable TARQ_ROOT stands in front of each
// path. A set-user-ID program ignores it.
//
// Header only: it holds as well on a system that brings the platform libraries itself.
#pragma once

#include <stdlib.h>

#include <cstdint>
#include <string>

namespace TARQ {

/// The folder that stands for "/", without a trailing slash; empty when the paths hold as they
/// stand.
inline std::string RootFolder() {
    const char* root = secure_getenv("TARQ_ROOT");
    std::string folder = root ? root : "";
    while (!folder.empty() && folder.back() == '/') {
        folder.pop_back();
    }
    return folder;
}

/// `path` (absolute) as it stands, or below the root folder when there is one.
inline std::string RootPath(const std::string& path) {
    return RootFolder() + path;
}

/// The semaphore key for `key`: itself without a root folder; otherwise a key of the folder's own,
/// so that two roots on one machine never wait for each other. Never 0 (IPC_PRIVATE) and never
/// negative.
inline int RootSemaphoreKey(int key) {
    const std::string folder = RootFolder();
    if (folder.empty()) {
        return key;
    }
    uint32_t hash = 2166136261U ^ static_cast<uint32_t>(key);  // FNV-1a over the folder's name
    for (const char c : folder) {
        hash = (hash ^ static_cast<unsigned char>(c)) * 16777619U;
    }
    hash &= 0x7fffffffU;
    return hash == 0 ? key : static_cast<int>(hash);
}

}  // namespace TARQ
