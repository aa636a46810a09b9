// The choices made by `zel_server setup`, stored in the section file
// /usr/tarq/etc/zel_server/server.conf.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "programs/common/failure.h"

namespace zel_server {

struct ServerConfig {
    int tls_port = 0;     ///< with TLS, for the network
    int plain_port = 0;   ///< without TLS: for this machine, where ssh tunnels end
    bool plain = false;   ///< the port without TLS also serves the network
    std::string address;  ///< to listen on; empty: all addresses of this machine
    std::string storage;  ///< folder that receives the shares
    std::map<std::string, std::string>
        volumes;             ///< additional folders, by the client's volume name
    bool encryption = true;  ///< encrypted shares are accepted
    bool closed = false;     ///< storage was once closed to others; earlier versions did not
    bool without_attributes =
        false;            ///< accept storage without extended attributes for owners and modes
    std::string user;     ///< system user that owns the copies; empty: whoever runs the daemon
    std::string program;  ///< path of zel_server, for the daemon's exec lines
    bool switched_off =
        false;  ///< the admin's last setting of the switch, in case the registry is lost

    /// All storage folders without duplicates, the default one first.
    std::vector<std::string> Folders() const;
};

/// The default ports. Below a root folder they are higher ones, which need no privileges.
int UsualTlsPort();
int UsualPlainPort();

/// The fixed paths, relative to the root folder.
std::string ConfigFolder();   ///< contains all of the following but the answers
std::string ConfigFile();     ///< server.conf
std::string RsyncdConfig();   ///< rsyncd.conf, written by setup
std::string ShareRecords();   ///< one file for each share
std::string DepositFolder();  ///< configurations of clients, a folder for each account
std::string SecretsFile();    ///< accounts and passwords, 0600
std::string AnswerFolder();   ///< command answers, a folder for each account; gone after a reboot
std::string OpenModules();    ///< folder of the open modules, in AnswerFolder()
std::string PushLinks();      ///< folder of the links of LinkOfPush(), in AnswerFolder()
std::string ConnectionConfigs();  ///< folder of connection_config.h's files, in AnswerFolder()
std::string RsyncdLog();          ///< the rsync daemon's
std::string FrontConfig();        ///< front.cfg, HAProxy's configuration, written at each start
std::string FrontKey();           ///< the server's key and certificate, 0600
std::string FrontFolder();        ///< folder of the socket on which the front reaches the daemon
std::string RegistryFile();       ///< the pairing registry
std::string LockFile();           ///< held by every command that changes the registry

/// Makes one of the folders in AnswerFolder(), and that, for this user alone. False, with errno
/// set, on failure.
bool MakeInAnswers(const std::string& folder);

/// Where earlier versions permanently kept a module for every share, and the admin's own modules.
std::string OldShareModules();
std::string OldAdminModules();

/// Reads server.conf; nothing when the server is not set up, or the file is damaged.
std::optional<ServerConfig> LoadServerConfig();
/// The same, but throws Failure of the given kind instead.
ServerConfig RequireServerConfig(programs::FailureKind otherwise = programs::FailureKind::kFailed);
/// Writes it. False, with errno set, on failure.
bool SaveServerConfig(const ServerConfig& config);

/// The storage folder for a client's volume name: the volume's own, or the default one.
std::string StorageFor(const ServerConfig& config, const std::string& volume_name);

/// Records which disk `folder` is on. Returns its mount path, or "" when that cannot be determined
/// or written.
std::string RecordDiskOf(const std::string& folder);
/// The recorded mount path; empty when there is none.
std::string RecordedDiskOf(const std::string& folder);
/// Whether the folder is still on that mount.
bool IsOnRecordedDisk(const std::string& folder);

}  // namespace zel_server
