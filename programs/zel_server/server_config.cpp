#include "programs/zel_server/server_config.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "base/rsync_config.h"
#include "base/text.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"
#include "tarq/share.h"

namespace zel_server {

namespace {

constexpr char kServerSection[] = "server";
constexpr char kVolumesSection[] = "volumes";
constexpr char kDisksSection[] = "disks";  // folder to mount path, as they were at set-up

using Entries = std::map<std::string, std::string>;

// None without a section.
Entries GetSection(const char* section) {
    const TARQ::HashOwner values(KAPICSzHashAlloc(16));
    const bool read =
        values && KAPICFileGetSection(ConfigFile().c_str(), section, values.get()) > 0;
    return read ? TARQ::Entries(values) : Entries();
}

bool SetSection(const char* section, const Entries& entries) {
    const TARQ::HashOwner values = TARQ::MakeHash(entries);
    return values &&
           KAPICFileSetSection(ConfigFile().c_str(), section, 0, values.get(), nullptr) > 0;
}

std::string MountPathOf(const std::string& folder) {
    TARQVolumePath volume = {};
    return VolumePathParseEx(folder.c_str(), &volume) == 0 ? volume.path : "";
}

}  // namespace

std::vector<std::string> ServerConfig::Folders() const {
    std::vector<std::string> folders = {storage};
    for (const auto& volume : volumes) {
        if (std::find(folders.begin(), folders.end(), volume.second) == folders.end()) {
            folders.push_back(volume.second);
        }
    }
    return folders;
}

std::string ConfigFolder() {
    return TARQ::RootPath("/usr/tarq/etc/zel_server");
}
std::string ConfigFile() {
    return ConfigFolder() + "/server.conf";
}
std::string RsyncdConfig() {
    return ConfigFolder() + "/rsyncd.conf";
}
std::string ShareModules() {
    return ConfigFolder() + "/shares.d";
}
std::string AdminModules() {
    return ConfigFolder() + "/admin.d";
}
std::string SecretsFile() {
    return ConfigFolder() + "/rsyncd.secrets";
}
std::string AnswerFolder() {
    return TARQ::RootPath("/var/run/zel_server");
}
std::string PidFile() {
    return TARQ::RootPath("/var/run/rsyncd.pid");
}
std::string RegistryFile() {
    return TARQ::RootPath("/usr/tarq/etc/tarqZEL.info");
}
std::string LockFile() {
    return ConfigFolder() + "/lock";
}

std::optional<ServerConfig> LoadServerConfig() {
    Entries values = GetSection(kServerSection);
    ServerConfig config;
    const auto port = base::ParseNumber(values["port"], base::kMaxPort);
    config.address = values["address"];
    config.storage = values["storage"];
    config.encryption = values["encryption"] != "no";
    config.user = values["user"];
    config.program = values["program"];
    config.switched_off = values["switch"] == "off";
    if (!port || *port == 0 || config.storage.empty() || config.program.empty()) {
        return std::nullopt;
    }
    config.port = static_cast<int>(*port);
    config.volumes = GetSection(kVolumesSection);
    return config;
}

ServerConfig RequireServerConfig(programs::FailureKind otherwise) {
    std::optional<ServerConfig> config = LoadServerConfig();
    if (!config) {
        throw programs::Failure(otherwise, "not set up: run 'zel_server setup --storage FOLDER'");
    }
    return *std::move(config);
}

bool SaveServerConfig(const ServerConfig& config) {
    return SetSection(kServerSection, {{"port", std::to_string(config.port)},
                                       {"address", config.address},
                                       {"storage", config.storage},
                                       {"encryption", config.encryption ? "yes" : "no"},
                                       {"user", config.user},
                                       {"program", config.program},
                                       {"switch", config.switched_off ? "off" : "on"}}) &&
           SetSection(kVolumesSection, config.volumes);
}

std::string StorageFor(const ServerConfig& config, const std::string& volume_name) {
    const auto volume = config.volumes.find(volume_name);
    return volume != config.volumes.end() ? volume->second : config.storage;
}

StorageState CheckStorage(const std::string& folder) {
    struct stat info = {};
    if (stat(folder.c_str(), &info) != 0) {
        return errno == EACCES ? StorageState::kNotPermitted : StorageState::kAbsent;
    }
    // A storage disk that is not mounted leaves an empty folder on another disk: nothing may be put
    // there.
    const std::string disk = RecordedDiskOf(folder);
    if (disk.empty() || disk != MountPathOf(folder)) {
        return StorageState::kOtherDisk;
    }
    if (!S_ISDIR(info.st_mode)) {
        return StorageState::kAbsent;
    }
    if (access(folder.c_str(), W_OK | X_OK) == 0) {
        return StorageState::kReady;
    }
    return errno == EROFS ? StorageState::kReadOnly : StorageState::kNotPermitted;
}

std::string RecordedDiskOf(const std::string& folder) {
    return GetSection(kDisksSection)[folder];
}

std::string RecordDiskOf(const std::string& folder) {
    const std::string mount_path = MountPathOf(folder);
    Entries entries = GetSection(kDisksSection);
    entries[folder] = mount_path;
    return !mount_path.empty() && SetSection(kDisksSection, entries) ? mount_path : "";
}

}  // namespace zel_server
