#include "programs/zel_server/setup.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <thread>

#include "ZEL/is_syncedshare.h"
#include "base/make_folder.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/connections.h"
#include "programs/zel_server/front.h"
#include "programs/zel_server/health.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/rsyncd_config.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/take_storage.h"
#include "programs/zel_server/version_retention.h"
#include "tarq/core.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;
using programs::Failure;
using programs::FailureKind;

constexpr char kStorageUser[] = "zel";
constexpr mode_t kOthersRights = S_IWGRP | S_IRWXO;
constexpr char kEverywhere[] = "all";
// Time that a daemon may take until it listens.
constexpr std::chrono::seconds kStartLimit(10);
constexpr std::chrono::milliseconds kStep(50);

bool IsSystem() {
    return TARQ::RootFolder().empty();
}

std::string Normal(const std::string& folder) {
    std::string normal = fs::path(folder).lexically_normal();
    if (normal.size() > 1 && normal.back() == '/') {
        normal.pop_back();
    }
    return normal;
}

// The current configuration, or the defaults for a new server.
ServerConfig ConfigBefore() {
    ServerConfig usual;
    usual.tls_port = UsualTlsPort();
    usual.plain_port = UsualPlainPort();
    usual.user = IsSystem() ? kStorageUser : "";
    return LoadServerConfig().value_or(usual);
}

void ConfigFrom(const SetupOptions& options, ServerConfig& config) {
    if (IsSystem() && geteuid() != 0) {
        throw Failure(
            "run it as root, or set TARQ_ROOT to a folder of yours to run a server in it");
    }
    if (!IsSystem() && !IsPlainPath(TARQ::RootFolder())) {
        throw Failure("TARQ_ROOT must be an absolute path without quotes, '%' or '\\'");
    }
    std::error_code error;
    config.program = fs::read_symlink("/proc/self/exe", error);
    if (!IsPlainPath(config.program)) {
        throw Failure("zel_server must be installed at a path without quotes, '%' or '\\'");
    }
    if (!options.storage.empty()) {
        config.storage = Normal(options.storage);
    }
    if (config.storage.empty()) {
        throw Failure(FailureKind::kUsage,
                      "a new server needs --storage FOLDER, the folder that receives the shares");
    }
    if (options.tls_port != 0) {
        config.tls_port = options.tls_port;
    }
    if (options.plain_port != 0) {
        config.plain_port = options.plain_port;
    }
    if (config.tls_port == config.plain_port) {
        throw Failure(FailureKind::kUsage, "--port and --plain-port cannot be the same");
    }
    config.plain = options.plain.value_or(config.plain);
    if (!options.address.empty()) {
        config.address = options.address == kEverywhere ? "" : options.address;
    }
    config.encryption = options.encryption.value_or(config.encryption);
    config.without_attributes = options.without_attributes.value_or(config.without_attributes);
    for (const std::string& volume : options.volumes) {
        const size_t equals = volume.find('=');
        const std::string name = volume.substr(0, equals);
        if (equals == std::string::npos || !IsShareName(name)) {
            throw Failure(FailureKind::kUsage,
                          "--volume takes NAME=FOLDER, not '" + programs::Printable(volume) + "'");
        }
        if (equals + 1 == volume.size()) {
            config.volumes.erase(name);
        } else {
            config.volumes[name] = Normal(volume.substr(equals + 1));
        }
    }
    // A server below a root folder does not create system users.
    if (IsSystem() && !options.user.empty()) {
        config.user = options.user;
    }
}

// ---- Checks before anything is changed ----

void LookAtFolder(const std::string& folder, const UnitState& unit) {
    if (!IsPlainPath(folder)) {
        throw Failure(
            "'" + folder +
            "' cannot be a storage folder: give an absolute path without quotes, '%' or '\\'");
    }
    // For a symbolic link, its target counts.
    std::error_code error;
    const std::string real = fs::weakly_canonical(folder, error);
    const std::string why = unit.confinement.Forbids(error ? folder : real);
    if (!why.empty()) {
        throw Failure("the storage folder cannot be " + folder + ": the unit " + kUnit +
                      " cannot write there (" + why + "); choose another, such as /srv/copies");
    }
}

void LookAtPorts(const ServerConfig& config) {
    const std::vector<Listener> listeners = Listeners(config);
    if (const auto holder = OtherHolder(config, listeners)) {
        const bool is_plain = holder->port == config.plain_port;
        throw Failure("port " + std::to_string(holder->port) + " is held by " + NameOf(*holder) +
                      ": end that, or choose another " + (is_plain ? "--plain-port" : "--port"));
    }
    if (ServesAll(config, listeners)) {
        return;
    }
    for (const Endpoint& endpoint : Endpoints(config)) {
        const int error = TryToListen(endpoint.address, endpoint.port);
        const std::string port = std::to_string(endpoint.port);
        if (error == EADDRNOTAVAIL) {
            throw Failure("this machine has no address '" + programs::Printable(endpoint.address) +
                          "'");
        }
        // Not an error if it is our own front, which is restarted later.
        if (error != 0 && error != EADDRINUSE) {
            throw Failure("cannot listen on port " + port + ": " + strerror(error));
        }
        if (error == EADDRINUSE && listeners.empty()) {
            throw Failure("port " + port +
                          " is held by somebody who does not listen there yet: choose another one, "
                          "or try again");
        }
    }
}

void LookAtEverything(const ServerConfig& config, const UnitState& unit) {
    for (const std::string& folder : config.Folders()) {
        LookAtFolder(folder, unit);
    }
    if (unit.masked) {
        throw Failure(std::string("the unit ") + kUnit + " is masked: systemctl unmask " + kUnit);
    }
    FrontUser();
    LookAtPorts(config);
}

// ---- Making the changes ----

// Creates the system user that owns the copies when the daemon runs as root, if it is missing.
void HaveStorageUser(const std::string& user) {
    if (user.empty() || getpwnam(user.c_str()) != nullptr) {
        return;
    }
    FILE* const useradd =
        KAPICPopen("/usr/sbin/useradd", "r", "--system", "--no-create-home", "--shell",
                   "/usr/sbin/nologin", user.c_str(), static_cast<const char*>(nullptr));
    if (useradd == nullptr || KAPICPclose(useradd) != 0 || getpwnam(user.c_str()) == nullptr) {
        throw Failure("cannot make the system user '" + user + "' that owns the copies");
    }
}

// These folders are only for root, or for whoever runs the server.
void MakeFolders() {
    const std::pair<std::string, mode_t> folders[] = {{ConfigFolder(), 0750},
                                                      {AnswerFolder(), 0700},
                                                      {OpenModules(), 0700},
                                                      {TARQ::RootPath("/var/log"), 0755}};
    for (const auto& [folder, mode] : folders) {
        if (!base::MakeFolder(folder, mode)) {
            throw programs::SystemFailure("cannot make " + folder);
        }
    }
}

void TakeRights(const std::string& path) {
    struct stat info = {};
    if (lstat(path.c_str(), &info) == 0 && !S_ISLNK(info.st_mode) &&
        (info.st_mode & kOthersRights) != 0) {
        chmod(path.c_str(), info.st_mode & ~kOthersRights & 07777);
    }
}

// Removes read access for others, which an earlier version or a umask may have left.
void CloseFiles() {
    for (const std::string& path : {ConfigFolder(), RegistryFile(), DamagedCopy(), RsyncdLog()}) {
        TakeRights(path);
    }
    for (const std::string& folder : {ConfigFolder(), ShareRecords()}) {
        std::error_code error;
        fs::directory_iterator entry(folder, error);
        for (; !error && entry != fs::directory_iterator(); entry.increment(error)) {
            TakeRights(entry->path());
        }
    }
}

// Earlier versions also served modules that the admin had written.
void TellOfOldAdminModules() {
    std::error_code error;
    if (!fs::is_empty(OldAdminModules(), error) && !error) {
        printf(
            "         NOTE: the modules in %s are served no more: they belong to the\n"
            "         system's own rsync daemon (/etc/rsyncd.conf), on another port\n",
            OldAdminModules().c_str());
    }
}

// A new server is switched on; an existing one keeps the admin's setting.
void TakeRegistry(bool is_new) {
    const RegistryLock lock;
    if (!lock.Held() || !TakeOverOldModules()) {
        throw programs::SystemFailure("cannot write the records of shares in " + ShareRecords());
    }
    if (is_new && ReadSwitch() == Switch::kUnknown) {
        if (TARQUISetZEL(1, nullptr, nullptr) != 0) {
            throw Failure("cannot write the registry " + RegistryFile() + ": " +
                          KAPICErrText(KAPICErrGet()));
        }
        return;
    }
    const auto damage = FindDamage();
    if (!damage || !damage->None()) {
        throw Failure("the registry " + RegistryFile() +
                      " is damaged or cannot be read: 'zel_server status' says what to do");
    }
}

// ---- The daemon ----

bool WaitUntilServed(const ServerConfig& config) {
    const auto limit = std::chrono::steady_clock::now() + kStartLimit;
    while (!ServingProcess() || !ServesAll(config, Listeners(config))) {
        if (std::chrono::steady_clock::now() > limit) {
            return false;
        }
        std::this_thread::sleep_for(kStep);
    }
    return true;
}

std::string Where(const ServerConfig& config) {
    return "port " + std::to_string(config.tls_port) +
           (config.address.empty() ? "" : " of " + config.address);
}

// Where no service manager knows the units, the admin has to start the server.
void TellHowToStart(const Health& now, const ServerConfig& config) {
    if (now.listens && !now.configuration_newer) {
        printf("Running: on %s\n", Where(config).c_str());
        return;
    }
    const std::string root = IsSystem() ? "" : "TARQ_ROOT='" + TARQ::RootFolder() + "' ";
    if (now.daemon) {
        printf(
            "Old:     the server that runs does not know this configuration: end process %ld "
            "first\n",
            static_cast<long>(*now.daemon));
    }
    printf(
        "To do:   no system manager that knows %s runs here; start the server by hand:\n"
        "             %szel_server serve\n"
        "         It then listens on %s, until it is ended.\n",
        kUnit, root.c_str(), Where(config).c_str());
}

void HaveDaemon(const ServerConfig& config) {
    const Health now = Examine(config);
    if (!now.unit.managed) {
        TellHowToStart(now, config);
        return;
    }
    const bool runs = now.unit.active == "active";
    if (!runs && now.daemon) {
        throw Failure("this server was started by hand: end process " +
                      std::to_string(*now.daemon) + ", then run 'zel_server setup' again");
    }
    const bool as_configured = runs && now.listens && !now.configuration_newer;
    if (!now.unit.enabled && !EnableUnit()) {
        throw Failure(std::string("cannot enable the unit ") + kUnit);
    }
    if (!as_configured && (!(runs ? RestartUnit() : StartUnit()) || !WaitUntilServed(config))) {
        throw Failure(std::string("the server does not start: 'journalctl -u ") + kUnit + " -u " +
                      kFrontUnit + "' and 'zel_server status' say why");
    }
    const char* const done = as_configured ? "Running: " : runs ? "Restarted: " : "Started: ";
    printf("%s%s, on %s%s%s\n", done, kUnit, Where(config).c_str(),
           now.unit.enabled ? "" : "; it starts with the machine from now on",
           runs && !as_configured ? "; pushes that were under way are tried again" : "");
}

// Prints what the admin needs to configure clients.
void TellAccess(const ServerConfig& config) {
    const std::string plain = std::to_string(config.plain_port);
    printf("Key:     %s\n         (clients ask whether it is this one when they first connect)\n",
           Fingerprint().value_or("?").c_str());
    if (config.plain) {
        printf(
            "NOTE:    port %s serves the network without encryption: anybody on the way can read "
            "and\n         change what travels there; 'zel_server setup --no-plain' ends that\n",
            plain.c_str());
    }
}

// Nothing when they stay as they are.
std::optional<KeepSettings> KeepSettingsFrom(const SetupOptions& options) {
    if (options.keep.empty() && options.keep_at_least.empty() && !options.reserve) {
        return std::nullopt;
    }
    KeepSettings settings = ReadKeepSettings().value_or(KeepSettings());
    if (!options.keep.empty()) {
        const auto keep = ParseRetention(options.keep);
        if (!keep) {
            throw Failure(FailureKind::kUsage,
                          "--keep takes all=, daily= and weekly=, each a number of days (d), weeks "
                          "(w) or years (y) and none shorter than the one before, as in "
                          "all=1d,daily=30d,weekly=1y; not '" +
                              programs::Printable(options.keep) + "'");
        }
        settings.retention = *keep;
    }
    if (!options.keep_at_least.empty()) {
        const auto age = ParseAge(options.keep_at_least);
        if (!age) {
            throw Failure(FailureKind::kUsage,
                          "--keep-at-least takes a number of days (d), weeks (w) or years (y), as "
                          "in 7d; not '" +
                              programs::Printable(options.keep_at_least) + "'");
        }
        settings.at_least = *age;
    }
    settings.reserve = options.reserve.value_or(settings.reserve);
    return settings;
}

}  // namespace

void Setup(const SetupOptions& options) {
    ServerConfig config = ConfigBefore();
    ConfigFrom(options, config);
    const auto keep = KeepSettingsFrom(options);
    LookAtEverything(config, AskUnit());
    const bool is_new = !LoadServerConfig();
    HaveStorageUser(config.user);
    MakeFolders();
    TakeStorage(config);
    config.closed = true;
    // The registry before the configuration, whose absence is the mark of a new server.
    TakeRegistry(is_new);
    if (options.certificate.empty()) {
        HaveFrontKey();
    } else {
        TakeFrontKey(options.certificate);
    }
    if (!SaveServerConfig(config) || (keep && !WriteKeepSettings(*keep)) ||
        !WriteRsyncdConfig(config)) {
        throw programs::SystemFailure("cannot write the configuration in " + ConfigFolder());
    }
    printf("Written: %s\n", RsyncdConfig().c_str());
    TellOfOldAdminModules();
    {
        const RegistryLock lock;
        if (lock.Held()) {
            MoveOpenCopies(config);
        }
    }
    CloseFiles();
    TellAccess(config);
    HaveDaemon(config);
    if (ReadSwitch() == Switch::kOff) {
        puts("Off:     clients are refused, as before: 'zel_server enable' lets them in");
    }
    const auto accounts = Accounts();
    if (accounts && accounts->empty()) {
        puts("Next:    zel_server account add NAME, for each client; it prints a password");
    }
}

}  // namespace zel_server
