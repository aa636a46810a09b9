// How the server is: what is configured beside what runs, and what that means for pushes.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "programs/zel_server/port.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/unit.h"

namespace zel_server {

struct Problem {
    std::string what;
    std::string mend;  ///< a command, or what to do
    bool stops_pushes = true;
};

/// A folder that receives shares.
struct StorageHealth {
    std::string folder;
    StorageState state = StorageState::kAbsent;
    std::optional<uint64_t> free_bytes;  ///< for the copies' user
    bool full = false;                   ///< of bytes or of inodes
};

struct Health {
    UnitState unit;
    std::vector<Listener> listeners;       ///< of the configured port
    std::optional<Listener> other_holder;  ///< of the configured port, that is not this server's
    std::optional<pid_t> daemon;           ///< the daemon that runs
    bool listens = false;                  ///< on all that is configured
    bool configuration_newer = false;      ///< than the daemon

    Switch on = Switch::kUnknown;
    std::string registry;  ///< "whole", "damaged" or "unreadable"
    std::optional<size_t> shares;
    std::optional<size_t> accounts;  ///< nothing when they cannot be read
    std::vector<StorageHealth> storage;

    std::vector<Problem> problems;
    bool PushesCanSucceed() const;
};

Health Examine(const ServerConfig& config);

/// Whoever listens where the server would have to, and is not this server's.
std::optional<Listener> OtherHolder(const ServerConfig& config,
                                    const std::vector<Listener>& listeners);
/// "nginx, process 123".
std::string NameOf(const Listener& listener);

/// Of these folders, those that do not belong to the user of the copies; none when there is no such
/// user, or anybody who runs the daemon owns them.
std::vector<std::string> ForeignFolders(const ServerConfig& config,
                                        const std::vector<std::string>& folders);
/// The problem that they are, and how to mend it.
Problem ForeignCopies(const ServerConfig& config, const std::vector<std::string>& folders);

/// "ready", "absent" ...
const char* Word(StorageState state);

}  // namespace zel_server
