#include "programs/zel_server/setup.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <thread>

#include "ZEL/is_syncedshare.h"
#include "base/rsync_config.h"
#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/complaint.h"
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

int ConfigFrom(const SetupOptions& options, ServerConfig& config) {
    if (IsSystem() && geteuid() != 0) {
        return Complain(
            "run it as root, or set TARQ_ROOT to a folder of yours to run a server in it");
    }
    if (!IsSystem() && !IsPlainPath(TARQ::RootFolder())) {
        return Complain("TARQ_ROOT must be an absolute path without quotes, '%' or '\\'");
    }
    std::error_code error;
    config.program = fs::read_symlink("/proc/self/exe", error);
    if (!IsPlainPath(config.program)) {
        return Complain("zel_server must be installed at a path without quotes, '%' or '\\'");
    }
    if (!options.storage.empty()) {
        config.storage = Normal(options.storage);
    }
    if (config.storage.empty()) {
        Complain("a new server needs --storage FOLDER, the folder that receives the shares");
        return kExitUsage;
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
            Complain("--volume takes NAME=FOLDER, not '" + programs::Printable(volume) + "'");
            return kExitUsage;
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
    return kExitOk;
}

// ---- Whether everything can be had; nothing is changed yet ----

int LookAtFolder(const std::string& folder, const UnitState& unit) {
    if (!IsPlainPath(folder)) {
        return Complain(
            "'" + folder +
            "' cannot be a storage folder: give an absolute path without quotes, '%' or '\\'");
    }
    // A link is no way out: where it leads to counts.
    std::error_code error;
    const std::string real = fs::weakly_canonical(folder, error);
    const std::string why = unit.confinement.Forbids(error ? folder : real);
    if (!why.empty()) {
        return Complain("the storage folder cannot be " + folder + ": the unit " + kUnit +
                        " cannot write there (" + why + "); choose another, such as /srv/copies");
    }
    return kExitOk;
}

int LookAtPort(const ServerConfig& config) {
    const std::vector<Listener> listeners = ListenersOn(config.port);
    if (const auto holder = OtherHolder(config, listeners)) {
        return Complain(
            "port " + std::to_string(config.port) + " is held by " + NameOf(*holder) +
            ": end that, or choose another --port" +
            (holder->program == "rsync"
                 ? "; modules of an rsync daemon of yours can move into " + AdminModules()
                 : ""));
    }
    if (ServesAll(config, listeners)) {
        return kExitOk;
    }
    for (const std::string& address : ServedAddresses(config)) {
        const int error = TryToListen(address, config.port);
        if (error == EADDRNOTAVAIL) {
            return Complain("this machine has no address '" + programs::Printable(address) + "'");
        }
        // Our own daemon may hold an address of several; it is started again.
        if (error != 0 && error != EADDRINUSE) {
            return Complain("cannot listen on port " + std::to_string(config.port) + ": " +
                            strerror(error));
        }
        if (error == EADDRINUSE && listeners.empty()) {
            return Complain("port " + std::to_string(config.port) +
                            " is held by somebody who does not listen there yet: choose another "
                            "--port, or try again");
        }
    }
    return kExitOk;
}

int LookAtEverything(const ServerConfig& config, const UnitState& unit) {
    for (const std::string& folder : config.Folders()) {
        const int result = LookAtFolder(folder, unit);
        if (result != kExitOk) {
            return result;
        }
    }
    if (unit.masked) {
        return Complain(std::string("the unit ") + kUnit + " is masked: systemctl unmask " + kUnit);
    }
    return LookAtPort(config);
}

// ---- Taking it ----

// The system user that owns the copies when the daemon runs as root, made when it is missing.
bool HaveStorageUser(const std::string& user) {
    if (user.empty() || getpwnam(user.c_str()) != nullptr) {
        return true;
    }
    FILE* const useradd =
        KAPICPopen("/usr/sbin/useradd", "r", "--system", "--no-create-home", "--shell",
                   "/usr/sbin/nologin", user.c_str(), static_cast<const char*>(nullptr));
    return useradd != nullptr && KAPICPclose(useradd) == 0 && getpwnam(user.c_str()) != nullptr;
}

bool MakeFolders(std::string& failed) {
    for (const std::string& folder : {ConfigFolder(), ShareModules(), AdminModules(),
                                      AnswerFolder(), TARQ::RootPath("/var/log")}) {
        std::error_code error;
        fs::create_directories(folder, error);
        if (error) {
            failed = folder + ": " + error.message();
            return false;
        }
    }
    return true;
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
int TakeFolder(const ServerConfig& config, const std::string& folder) {
    std::error_code error;
    fs::create_directories(folder, error);
    if (error) {
        return Complain("cannot make the storage folder '" + folder + "': " + error.message());
    }
    const std::string disk = RecordDiskOf(folder);
    if (disk.empty()) {
        return Complain("cannot tell which disk '" + folder +
                        "' is on: " + KAPICErrText(KAPICErrGet()));
    }
    const StorageState state = CheckStorage(folder);
    if (state == StorageState::kReadOnly) {
        return Complain("the storage folder " + folder + " is on a disk that is mounted read-only");
    }
    if (state != StorageState::kReady) {
        return Complain("the storage folder " + folder +
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
    return kExitOk;
}

// The switch of a new server is on; the admin's word for one that was set up before stays.
int TakeRegistry(bool is_new) {
    const RegistryLock lock;
    if (is_new && ReadSwitch() == Switch::kUnknown) {
        return lock.Held() && TARQUISetZEL(1, nullptr, nullptr) == 0
                   ? kExitOk
                   : Complain("cannot write the registry " + RegistryFile() + ": " +
                              KAPICErrText(KAPICErrGet()));
    }
    const auto damage = FindDamage();
    if (!damage || !damage->None()) {
        return Complain("the registry " + RegistryFile() +
                        " is damaged or cannot be read: 'zel_server status' says what to do");
    }
    return kExitOk;
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
int TellHowToStart(const Health& now, const ServerConfig& config) {
    if (now.listens && !now.configuration_newer) {
        printf("Running: the rsync daemon, on %s\n", Where(config).c_str());
        return kExitOk;
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
    return kExitOk;
}

int HaveDaemon(const ServerConfig& config) {
    const Health now = Examine(config);
    if (!now.unit.managed) {
        return TellHowToStart(now, config);
    }
    const bool runs = now.unit.active == "active";
    if (!runs && now.daemon) {
        return Complain("an rsync daemon of this server was started by hand: end process " +
                        std::to_string(*now.daemon) + ", then run 'zel_server setup' again");
    }
    const bool as_configured = runs && now.listens && !now.configuration_newer;
    if (!now.unit.enabled && !EnableUnit()) {
        return Complain(std::string("cannot enable the unit ") + kUnit);
    }
    if (!as_configured && (!(runs ? RestartUnit() : StartUnit()) || !WaitUntilServed(config))) {
        return Complain(std::string("the rsync daemon does not start: 'journalctl -u ") + kUnit +
                        "' and 'zel_server status' say why");
    }
    const char* const done = as_configured ? "Running: " : runs ? "Restarted: " : "Started: ";
    printf("%s%s, on %s%s%s\n", done, kUnit, Where(config).c_str(),
           now.unit.enabled ? "" : "; it starts with the machine from now on",
           runs && !as_configured ? "; pushes that were under way are tried again" : "");
    return kExitOk;
}

}  // namespace

int Setup(const SetupOptions& options) {
    ServerConfig config = ConfigBefore();
    int result = ConfigFrom(options, config);
    if (result == kExitOk) {
        result = LookAtEverything(config, AskUnit());
    }
    if (result != kExitOk) {
        return result;
    }
    const bool is_new = !LoadServerConfig();
    std::string failed;
    if (!HaveStorageUser(config.user)) {
        return Complain("cannot make the system user '" + config.user + "' that owns the copies");
    }
    if (!MakeFolders(failed)) {
        return Complain("cannot make " + failed);
    }
    for (const std::string& folder : config.Folders()) {
        result = result == kExitOk ? TakeFolder(config, folder) : result;
    }
    // The registry before the configuration: a new server is one without configuration.
    result = result == kExitOk ? TakeRegistry(is_new) : result;
    if (result != kExitOk) {
        return result;
    }
    if (!SaveServerConfig(config) || !WriteRsyncdConfig(config)) {
        return ComplainErrno("cannot write the configuration in " + ConfigFolder());
    }
    printf("Written: %s\n         (your own modules go into %s)\n", RsyncdConfig().c_str(),
           AdminModules().c_str());
    result = HaveDaemon(config);
    if (result == kExitOk && ReadSwitch() == Switch::kOff) {
        puts("Off:     clients are refused, as before: 'zel_server enable' lets them in");
    }
    const auto accounts = Accounts();
    if (result == kExitOk && accounts && accounts->empty()) {
        puts("Next:    zel_server account add NAME, for each client");
    }
    return result;
}

}  // namespace zel_server
