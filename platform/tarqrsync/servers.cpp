#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>

#include "base/config_file.h"
#include "base/file_lock.h"
#include "base/rsync_config.h"
#include "base/text.h"
#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "platform/tarqrsync/host_keys.h"
#include "platform/tarqrsync/known_hosts.h"
#include "platform/tarqrsync/servers_file.h"
#include "tarq/core.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"
#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr char kServersPath[] = "/usr/tarq/etc/tarqrsync_servers";
constexpr size_t kMaxBytes = size_t{8} << 20;
constexpr std::chrono::seconds kLockPatience(10);
constexpr int kTlsPort = 874;
constexpr int kSshPort = 22;

[[noreturn]] void Refuse(const std::string& what) {
    throw ServersError(what + ": " + strerror(errno));
}

// Whoever may write the file says whom this machine trusts.
void CheckOwner(int file, const std::string& path) {
    struct stat info = {};
    if (fstat(file, &info) != 0) {
        Refuse(path + " cannot be looked at");
    }
    if (!S_ISREG(info.st_mode)) {
        throw ServersError(path + " is no file");
    }
    if ((info.st_uid != 0 && info.st_uid != geteuid()) ||
        (info.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        throw ServersError(path + " may be written by others: it says which servers are trusted. " +
                           "Look through it; then: chown root " + path + " && chmod 644 " + path);
    }
}

std::vector<ServerSection> ReadSections() {
    const std::string path = ServersPath();
    const base::UniqueFd file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (!file) {
        if (errno == ENOENT || errno == ENOTDIR) {
            return {};
        }
        Refuse(path + " cannot be read");
    }
    CheckOwner(file.Get(), path);
    const std::optional<std::string> text = base::ReadAll(file.Get(), kMaxBytes);
    if (!text) {
        Refuse(path + " cannot be read");
    }
    return ParseServers(*text, path);
}

/// Keeps other writers of the files out while it lives.
base::FileLock LockFiles() {
    base::FileLock lock(ServersPath() + ".lock", kLockPatience);
    if (!lock) {
        throw ServersError("cannot write " + ServersPath() + ": " + lock.Problem());
    }
    return lock;
}

std::string KnownHosts() {
    return RootPath(kKnownHostsPath);
}

// The section's name in the file: people may have written it in another case.
std::optional<std::string> SectionOf(const std::string& host) {
    const std::vector<ServerSection> sections = ReadSections();
    const std::string name = ServerName(host);
    const auto found =
        std::find_if(sections.begin(), sections.end(),
                     [&](const ServerSection& entry) { return entry.server.host == name; });
    return found == sections.end() ? std::nullopt : std::optional(found->section);
}

[[noreturn]] void RefuseToWrite() {
    throw ServersError("cannot write " + ServersPath() + ": " + KAPICErrText(KAPICErrGet()));
}

}  // namespace

std::string ServersPath() {
    return RootPath(kServersPath);
}

std::string ServerName(const std::string& host) {
    in6_addr address;
    std::array<char, INET6_ADDRSTRLEN> text;
    if (inet_pton(AF_INET6, host.c_str(), &address) == 1 &&
        inet_ntop(AF_INET6, &address, text.data(), text.size()) != nullptr) {
        return text.data();
    }
    return base::Lower(host);
}

bool IsLoopbackHost(const std::string& host) {
    in_addr address;
    if (inet_pton(AF_INET, host.c_str(), &address) == 1) {
        return ntohl(address.s_addr) >> 24 == 127;
    }
    const std::string name = ServerName(host);
    return name == "::1" || name == "localhost";
}

int DefaultServerPort(ServerTransport transport) {
    switch (transport) {
        case ServerTransport::TLS:
            return kTlsPort;
        case ServerTransport::SSH:
            return kSshPort;
        default:
            try {
                return base::ReadRsyncConfig(RootPath(base::kRsyncConfigPath)).daemon_port;
            } catch (const base::ConfigError& error) {
                throw ServersError(error.what());
            }
    }
}

std::vector<RsyncServer> ListServers() {
    std::vector<RsyncServer> servers;
    for (ServerSection& section : ReadSections()) {
        servers.push_back(std::move(section.server));
    }
    return servers;
}

std::optional<RsyncServer> FindServer(const std::string& host) {
    const std::string name = ServerName(host);
    for (RsyncServer& server : ListServers()) {
        if (server.host == name) {
            return std::move(server);
        }
    }
    return {};
}

void TrustServer(const RsyncServer& server, const std::optional<SshHostKey>& host_key) {
    RsyncServer wanted = server;
    wanted.host = ServerName(server.host);
    const std::string fault = FaultOf(wanted);
    if (!fault.empty()) {
        throw ServersError(fault);
    }
    std::map<std::string, std::string> values = {{"transport", TransportWord(wanted.transport)}};
    if (wanted.port != 0) {
        values["port"] = std::to_string(wanted.port);
    }
    if (!wanted.fingerprint.empty()) {
        values["fingerprint"] = wanted.fingerprint;
    }
    const TARQ::HashOwner lines = TARQ::MakeHash(values);
    const base::FileLock lock = LockFiles();
    const std::string section = SectionOf(wanted.host).value_or(wanted.host);
    if (host_key) {
        WriteKnownHost(KnownHosts(), wanted.host, host_key->key);
    }
    if (!lines ||
        KAPICFileSetSection(ServersPath().c_str(), section.c_str(), 0, lines.get(), nullptr) < 0) {
        RefuseToWrite();
    }
}

bool ForgetServer(const std::string& host) {
    const base::FileLock lock = LockFiles();
    const std::optional<std::string> section = SectionOf(host);
    if (!section) {
        return false;
    }
    if (KAPICFileRemoveSection(ServersPath().c_str(), section->c_str()) < 0) {
        RefuseToWrite();
    }
    WriteKnownHost(KnownHosts(), ServerName(host), {});
    return true;
}

std::optional<SshHostKey> FindHostKey(const std::string& host) {
    const std::optional<std::string> key = ReadKnownHost(KnownHosts(), ServerName(host));
    return key ? std::optional(SshHostKey{*key, FingerprintOfHostKey(*key)}) : std::nullopt;
}

}  // namespace Backup
}  // namespace TARQ
