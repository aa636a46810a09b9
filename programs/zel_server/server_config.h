// What `zel_server setup` has decided, kept in the section file
// /usr/tarq/etc/zel_server/server.conf.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "programs/common/failure.h"

namespace zel_server {

struct ServerConfig {
    int port = 0;         ///< the rsync daemon's
    std::string address;  ///< it listens there; empty: everywhere
    std::string storage;  ///< folder that receives the shares
    std::map<std::string, std::string>
        volumes;             ///< further folders, by the volume name that a client tells
    bool encryption = true;  ///< encrypted shares are accepted
    std::string user;        ///< system user that owns the copies; empty: who runs the daemon
    std::string program;     ///< path of zel_server, for the daemon's exec lines
    bool switched_off =
        false;  ///< the registry's switch as the admin last turned it, should that be lost

    /// All folders that receive shares, the common one first, each once.
    std::vector<std::string> Folders() const;
};

/// The fixed places, below the root folder.
std::string ConfigFolder();  ///< all of the following but the answers
std::string ConfigFile();    ///< server.conf
std::string RsyncdConfig();  ///< rsyncd.conf, written by setup
std::string ShareModules();  ///< folder of the shares' modules, one file each
std::string AdminModules();  ///< folder of the admin's own modules
std::string SecretsFile();   ///< accounts and passwords, 0600
std::string AnswerFolder();  ///< one folder per account, of command answers
std::string PidFile();       ///< the rsync daemon's
std::string RegistryFile();  ///< the pairing registry
std::string LockFile();      ///< held by every command and outcome that changes the registry

/// Reads server.conf; nothing when the server is not set up or the file is damaged.
std::optional<ServerConfig> LoadServerConfig();
/// The same; throws Failure of that kind when there is none.
ServerConfig RequireServerConfig(programs::FailureKind otherwise = programs::FailureKind::kFailed);
/// Writes it. False, with errno set, on failure.
bool SaveServerConfig(const ServerConfig& config);

/// The folder for shares of the volume that a client names: that volume's, or the common one.
std::string StorageFor(const ServerConfig& config, const std::string& volume_name);

/// How a storage folder is. kOtherDisk: not on the disk that it was on at set-up.
enum class StorageState { kReady, kAbsent, kOtherDisk, kReadOnly, kNotPermitted };
StorageState CheckStorage(const std::string& folder);

/// Remembers which disk `folder` is on, for CheckStorage; its mount path, empty when that cannot be
/// told or written.
std::string RecordDiskOf(const std::string& folder);
/// The mount path that was remembered; empty when none was.
std::string RecordedDiskOf(const std::string& folder);

}  // namespace zel_server
