// The state of the server: its configuration compared with what runs, and what that means for
// pushes.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "programs/zel_server/front.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/storage.h"
#include "programs/zel_server/unit.h"

namespace zel_server {

struct Problem {
    std::string what;
    std::string mend;  ///< a command, or advice
    bool stops_pushes = true;
};

/// The state of a storage folder.
struct StorageHealth {
    std::string folder;
    StorageState state = StorageState::kAbsent;
    std::optional<uint64_t> free_bytes;  ///< for the user of the copies
    bool full = false;                   ///< out of bytes or inodes
};

struct Health {
    UnitState unit;
    std::vector<Listener> listeners;       ///< of the configured ports
    std::optional<Listener> other_holder;  ///< of a configured port, not part of this server
    std::optional<pid_t> daemon;           ///< `zel_server serve`
    std::optional<pid_t> front;            ///< HAProxy
    bool listens = false;                  ///< on all configured ports
    bool configuration_newer = false;      ///< than what the front runs with
    std::optional<std::string> fingerprint;

    Switch on = Switch::kUnknown;
    std::string registry;  ///< "whole", "damaged" or "unreadable"
    std::optional<size_t> shares;
    std::optional<size_t> accounts;  ///< enabled ones; nothing when unreadable
    std::vector<StorageHealth> storage;

    std::vector<Problem> problems;
    bool PushesCanSucceed() const;
};

Health Examine(const ServerConfig& config);

/// "'a', 'b', 'c' and 4 more".
std::string Listed(const std::vector<std::string>& names);
/// "nginx, process 123".
std::string NameOf(const Listener& listener);

/// Those of the folders that do not belong to the user of the copies; none when there is no such
/// user, or when the daemon has no user set.
std::vector<std::string> ForeignFolders(const ServerConfig& config,
                                        const std::vector<std::string>& folders);
/// The problem with these folders, and how to solve it.
Problem ForeignCopies(const ServerConfig& config, const std::vector<std::string>& folders);

/// "ready", "absent" ...
const char* Word(StorageState state);

}  // namespace zel_server
