#include "programs/zel_server/server_config.h"

#include <algorithm>

#include "base/make_folder.h"
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
constexpr int kUnprivileged = 8000;  // added to the usual ports below a root folder
constexpr char kVolumesSection[] = "volumes";
constexpr char kDisksSection[] = "disks";  // folder to mount path, recorded at set-up

using Entries = std::map<std::string, std::string>;

// Empty when there is no such section.
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

int UsualTlsPort() {
    return TARQ::RootFolder().empty() ? base::kRsyncTlsPort : kUnprivileged + base::kRsyncTlsPort;
}
int UsualPlainPort() {
    return TARQ::RootFolder().empty() ? base::kRsyncPort : kUnprivileged + base::kRsyncPort;
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
std::string DepositFolder() {
    return ConfigFolder() + "/deposits";
}

std::string ShareRecords() {
    return ConfigFolder() + "/shares";
}
std::string SecretsFile() {
    return ConfigFolder() + "/rsyncd.secrets";
}
std::string AnswerFolder() {
    return TARQ::RootPath("/var/run/zel_server");
}
std::string OpenModules() {
    return AnswerFolder() + "/.open";  // no account name begins with a dot
}

std::string PushLinks() {
    return AnswerFolder() + "/.pushes";
}
std::string ConnectionConfigs() {
    return AnswerFolder() + "/.configs";
}
bool MakeInAnswers(const std::string& folder) {
    return base::MakeFolder(AnswerFolder(), 0700) && base::MakeFolder(folder, 0700);
}
std::string FrontConfig() {
    return ConfigFolder() + "/front.cfg";
}
std::string FrontKey() {
    return ConfigFolder() + "/front.pem";
}
std::string FrontFolder() {
    return TARQ::RootPath("/var/run/zel_front");
}
std::string RsyncdLog() {
    return TARQ::RootPath("/var/log/rsyncd.log");
}
std::string RegistryFile() {
    return TARQ::RootPath("/usr/tarq/etc/tarqZEL.info");
}
std::string LockFile() {
    return ConfigFolder() + "/lock";
}
std::string OldShareModules() {
    return ConfigFolder() + "/shares.d";
}
std::string OldAdminModules() {
    return ConfigFolder() + "/admin.d";
}

std::optional<ServerConfig> LoadServerConfig() {
    Entries values = GetSection(kServerSection);
    ServerConfig config;
    const auto plain_port = base::ParseNumber(values["port"], base::kMaxPort);
    // A server that was set up before TLS was supported stays as it was until its admin changes it.
    const bool is_old = values["tls_port"].empty();
    const auto tls_port = base::ParseNumber(
        is_old ? std::to_string(UsualTlsPort()) : values["tls_port"], base::kMaxPort);
    config.plain = is_old || values["plain"] == "yes";
    config.address = values["address"];
    config.storage = values["storage"];
    config.encryption = values["encryption"] != "no";
    config.closed = values["closed"] == "yes";
    config.without_attributes = values["without_attributes"] == "yes";
    config.user = values["user"];
    config.program = values["program"];
    config.switched_off = values["switch"] == "off";
    if (plain_port.value_or(0) == 0 || tls_port.value_or(0) == 0 || config.storage.empty() ||
        config.program.empty()) {
        return std::nullopt;
    }
    config.plain_port = static_cast<int>(*plain_port);
    config.tls_port = static_cast<int>(*tls_port);
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
    return SetSection(kServerSection,
                      {{"port", std::to_string(config.plain_port)},
                       {"tls_port", std::to_string(config.tls_port)},
                       {"plain", config.plain ? "yes" : "no"},
                       {"address", config.address},
                       {"storage", config.storage},
                       {"encryption", config.encryption ? "yes" : "no"},
                       {"closed", config.closed ? "yes" : "no"},
                       {"without_attributes", config.without_attributes ? "yes" : "no"},
                       {"user", config.user},
                       {"program", config.program},
                       {"switch", config.switched_off ? "off" : "on"}}) &&
           SetSection(kVolumesSection, config.volumes);
}

std::string StorageFor(const ServerConfig& config, const std::string& volume_name) {
    const auto volume = config.volumes.find(volume_name);
    return volume != config.volumes.end() ? volume->second : config.storage;
}

bool IsOnRecordedDisk(const std::string& folder) {
    const std::string disk = RecordedDiskOf(folder);
    return !disk.empty() && disk == MountPathOf(folder);
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
