#include "programs/zel_server/setup.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <thread>

#include "ZEL/is_syncedshare.h"
#include "base/rsync_config.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/health.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/rsyncd_config.h"
#include "programs/zel_server/serve.h"
#include "tarq/core.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;
using programs::Failure;
using programs::FailureKind;

constexpr int kUnprivilegedPort = 8873;
constexpr char kStorageUser[] = "zel";
constexpr char kEverywhere[] = "all";
// How long a daemon may take until it listens.
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

// What holds when nothing is said: what was said before, or else what is usual.
ServerConfig ConfigBefore() {
    ServerConfig usual;
    usual.port = IsSystem() ? base::kRsyncPort : kUnprivilegedPort;
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
    if (options.port != 0) {
        config.port = options.port;
    }
    if (!options.address.empty()) {
        config.address = options.address == kEverywhere ? "" : options.address;
    }
    config.encryption = options.encryption.value_or(config.encryption);
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
    // A server in a folder of its own leaves the machine's users alone.
    if (IsSystem() && !options.user.empty()) {
        config.user = options.user;
    }
}

// ---- Whether everything can be had; nothing is changed yet ----

void LookAtFolder(const std::string& folder, const UnitState& unit) {
    if (!IsPlainPath(folder)) {
        throw Failure(
            "'" + folder +
            "' cannot be a storage folder: give an absolute path without quotes, '%' or '\\'");
    }
    // A link is no way out: where it leads to counts.
    std::error_code error;
    const std::string real = fs::weakly_canonical(folder, error);
    const std::string why = unit.confinement.Forbids(error ? folder : real);
    if (!why.empty()) {
        throw Failure("the storage folder cannot be " + folder + ": the unit " + kUnit +
                      " cannot write there (" + why + "); choose another, such as /srv/copies");
    }
}

void LookAtPort(const ServerConfig& config) {
    const std::vector<Listener> listeners = ListenersOn(config.port);
    if (const auto holder = OtherHolder(config, listeners)) {
        throw Failure("port " + std::to_string(config.port) + " is held by " + NameOf(*holder) +
                      ": end that, or choose another --port" +
                      (holder->program == "rsync"
                           ? "; modules of an rsync daemon of yours can move into " + AdminModules()
                           : ""));
    }
    if (ServesAll(config, listeners)) {
        return;
    }
    for (const std::string& address : ServedAddresses(config)) {
        const int error = TryToListen(address, config.port);
        if (error == EADDRNOTAVAIL) {
            throw Failure("this machine has no address '" + programs::Printable(address) + "'");
        }
        // Our own daemon may hold an address of several; it is started again.
        if (error != 0 && error != EADDRINUSE) {
            throw Failure("cannot listen on port " + std::to_string(config.port) + ": " +
                          strerror(error));
        }
        if (error == EADDRINUSE && listeners.empty()) {
            throw Failure("port " + std::to_string(config.port) +
                          " is held by somebody who does not listen there yet: choose another "
                          "--port, or try again");
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
    LookAtPort(config);
}

// ---- Taking it ----

// The system user that owns the copies when the daemon runs as root, made when it is missing.
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

void MakeFolders() {
    for (const std::string& folder : {ConfigFolder(), ShareModules(), AdminModules(),
                                      AnswerFolder(), TARQ::RootPath("/var/log")}) {
        std::error_code error;
        fs::create_directories(folder, error);
        if (error) {
            throw Failure("cannot make " + folder + ": " + error.message());
        }
    }
}

bool IsInMemory(const std::string& folder) {
    constexpr uint32_t kTmpfs = 0x01021994;
    constexpr uint32_t kRamfs = 0x858458f6;
    struct statfs info = {};
    if (statfs(folder.c_str(), &info) != 0) {
        return false;
    }
    const auto type = static_cast<uint32_t>(info.f_type);
    return type == kTmpfs || type == kRamfs;
}

// What lies in a storage folder already and could be shares' copies.
std::vector<std::string> CopiesIn(const std::string& storage) {
    std::vector<std::string> copies;
    std::error_code error;
    for (fs::directory_iterator entry(storage, error), end; !error && entry != end;
         entry.increment(error)) {
        std::error_code gone;
        const std::string name = entry->path().filename();
        if (fs::is_directory(entry->symlink_status(gone)) && name != "lost+found" &&
            (IsShareName(name) || IsShareName(ShareOfModule(name)))) {
            copies.push_back(entry->path());
        }
    }
    return copies;
}

// Makes a storage folder and says which disk it is on, and what is odd about it.
void TakeFolder(const ServerConfig& config, const std::string& folder) {
    std::error_code error;
    fs::create_directories(folder, error);
    if (error) {
        throw Failure("cannot make the storage folder '" + folder + "': " + error.message());
    }
    const std::string disk = RecordDiskOf(folder);
    if (disk.empty()) {
        throw Failure("cannot tell which disk '" + folder +
                      "' is on: " + KAPICErrText(KAPICErrGet()));
    }
    const StorageState state = CheckStorage(folder);
    if (state == StorageState::kReadOnly) {
        throw Failure("the storage folder " + folder + " is on a disk that is mounted read-only");
    }
    if (state != StorageState::kReady) {
        throw Failure("the storage folder " + folder +
                      " cannot be used: it is no folder, or may not be written");
    }
    printf("Storage: %s, on the disk mounted at %s\n", folder.c_str(), disk.c_str());
    if (IsSystem() && IsInMemory(folder)) {
        printf("         NOTE: that is in memory: the copies are gone when the machine starts\n");
    }
    const std::vector<std::string> foreign = ForeignFolders(config, CopiesIn(folder));
    if (!foreign.empty()) {
        const Problem problem = ForeignCopies(config, foreign);
        printf("         NOTE: %s\n         %s\n", problem.what.c_str(), problem.mend.c_str());
    }
}

// The switch of a new server is on; the admin's word for one that was set up before stays.
void TakeRegistry(bool is_new) {
    const RegistryLock lock;
    if (is_new && ReadSwitch() == Switch::kUnknown) {
        if (!lock.Held() || TARQUISetZEL(1, nullptr, nullptr) != 0) {
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
    while (!ServesAll(config, ListenersOn(config.port))) {
        if (std::chrono::steady_clock::now() > limit) {
            return false;
        }
        std::this_thread::sleep_for(kStep);
    }
    return true;
}

std::string Where(const ServerConfig& config) {
    std::string where = "port " + std::to_string(config.port);
    if (!config.address.empty()) {
        where += " of " + config.address;
    }
    const std::vector<std::string> addresses = ServedAddresses(config);
    return addresses.size() == 1 ? where
                                 : where + ", and of " + addresses.back() + " for ssh clients";
}

// Without a manager that knows the unit, the admin starts the daemon.
void TellHowToStart(const Health& now, const ServerConfig& config) {
    if (now.listens && !now.configuration_newer) {
        printf("Running: the rsync daemon, on %s\n", Where(config).c_str());
        return;
    }
    const std::string root = IsSystem() ? "" : "TARQ_ROOT='" + TARQ::RootFolder() + "' ";
    if (now.daemon) {
        printf(
            "Old:     the rsync daemon that runs does not know this configuration: end process "
            "%ld first\n",
            static_cast<long>(*now.daemon));
    }
    printf(
        "To do:   no system manager that knows %s runs here; start the rsync daemon by hand:\n"
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
        throw Failure("an rsync daemon of this server was started by hand: end process " +
                      std::to_string(*now.daemon) + ", then run 'zel_server setup' again");
    }
    const bool as_configured = runs && now.listens && !now.configuration_newer;
    if (!now.unit.enabled && !EnableUnit()) {
        throw Failure(std::string("cannot enable the unit ") + kUnit);
    }
    if (!as_configured && (!(runs ? RestartUnit() : StartUnit()) || !WaitUntilServed(config))) {
        throw Failure(std::string("the rsync daemon does not start: 'journalctl -u ") + kUnit +
                      "' and 'zel_server status' say why");
    }
    const char* const done = as_configured ? "Running: " : runs ? "Restarted: " : "Started: ";
    printf("%s%s, on %s%s%s\n", done, kUnit, Where(config).c_str(),
           now.unit.enabled ? "" : "; it starts with the machine from now on",
           runs && !as_configured ? "; pushes that were under way are tried again" : "");
}

}  // namespace

void Setup(const SetupOptions& options) {
    ServerConfig config = ConfigBefore();
    ConfigFrom(options, config);
    LookAtEverything(config, AskUnit());
    const bool is_new = !LoadServerConfig();
    HaveStorageUser(config.user);
    MakeFolders();
    for (const std::string& folder : config.Folders()) {
        TakeFolder(config, folder);
    }
    // The registry before the configuration: a new server is one without configuration.
    TakeRegistry(is_new);
    if (!SaveServerConfig(config) || !WriteRsyncdConfig(config)) {
        throw programs::SystemFailure("cannot write the configuration in " + ConfigFolder());
    }
    printf("Written: %s\n         (your own modules go into %s)\n", RsyncdConfig().c_str(),
           AdminModules().c_str());
    HaveDaemon(config);
    if (ReadSwitch() == Switch::kOff) {
        puts("Off:     clients are refused, as before: 'zel_server enable' lets them in");
    }
    const auto accounts = Accounts();
    if (accounts && accounts->empty()) {
        puts("Next:    zel_server account add NAME, for each client");
    }
}

}  // namespace zel_server
