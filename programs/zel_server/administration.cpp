// What the admin types: set-up, switch, accounts, and what there is to see.
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <limits>
#include <nlohmann/json.hpp>

#include "ZEL/is_syncedshare.h"
#include "programs/common/command_line.h"
#include "programs/common/help.h"
#include "programs/common/table.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/rsyncd_config.h"
#include "programs/zel_server/server_config.h"
#include "tarq/core.h"
#include "tarq/root_path.h"

namespace {

namespace fs = std::filesystem;
using programs::Table;
using namespace zel_server;

constexpr int kOk = 0;
constexpr int kFailed = 1;
constexpr int kUsage = 2;

constexpr int kSystemPort = 873;  // rsync's own; only root may listen there
constexpr int kUnprivilegedPort = 8873;
constexpr char kStorageUser[] = "zel";
constexpr char kMultiSourceMarker[] = "ZELMULTI-SRC-SUPPORT";

int Fail(const std::string& message) {
    fprintf(stderr, "zel_server: %s\n", message.c_str());
    return kFailed;
}

int FailErrno(const std::string& what) {
    return Fail(what + ": " + strerror(errno));
}

std::string ThisProgram() {
    std::error_code error;
    return fs::read_symlink("/proc/self/exe", error);
}

// ---- Set-up ----

struct SetupOptions {
    std::string storage;
    std::vector<std::string> volumes;  // NAME=FOLDER
    std::string address;
    std::string user;
    int port = 0;
    bool no_encryption = false;
};

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

// The system user that owns the copies when the daemon runs as root, made when it is missing.
bool HaveStorageUser(const std::string& user) {
    if (getpwnam(user.c_str()) != nullptr) {
        return true;
    }
    FILE* const useradd =
        KAPICPopen("/usr/sbin/useradd", "r", "--system", "--no-create-home", "--shell",
                   "/usr/sbin/nologin", user.c_str(), static_cast<const char*>(nullptr));
    return useradd != nullptr && KAPICPclose(useradd) == 0 && getpwnam(user.c_str()) != nullptr;
}

// Makes a storage folder and says which disk it is on.
int TakeFolder(const std::string& folder) {
    if (!IsPlainPath(folder)) {
        return Fail(
            "'" + folder +
            "' cannot be a storage folder: give an absolute path without quotes, '%' or '\\'");
    }
    std::error_code error;
    fs::create_directories(folder, error);
    if (error) {
        return Fail("cannot make the storage folder '" + folder + "': " + error.message());
    }
    const std::string disk = RecordDiskOf(folder);
    if (disk.empty()) {
        return Fail("cannot tell which disk '" + folder +
                    "' is on: " + KAPICErrText(KAPICErrGet()));
    }
    printf("Storage: %s, on the disk mounted at %s\n", folder.c_str(), disk.c_str());
    return kOk;
}

int Setup(const SetupOptions& options) {
    const bool is_system = TARQ::RootFolder().empty();
    if (is_system && geteuid() != 0) {
        return Fail("run it as root, or set TARQ_ROOT to a folder of yours to run a server in it");
    }
    if (!is_system && !IsPlainPath(TARQ::RootFolder())) {
        return Fail("TARQ_ROOT must be an absolute path without quotes, '%' or '\\'");
    }
    ServerConfig config;
    config.port = options.port != 0 ? options.port : is_system ? kSystemPort : kUnprivilegedPort;
    config.address = options.address;
    config.storage = fs::path(options.storage).lexically_normal();
    config.encryption = !options.no_encryption;
    config.program = ThisProgram();
    if (config.storage.size() > 1 && config.storage.back() == '/') {
        config.storage.pop_back();
    }
    if (!IsPlainPath(config.program)) {
        return Fail("zel_server must be installed at a path without quotes, '%' or '\\'");
    }
    for (const std::string& volume : options.volumes) {
        const size_t equals = volume.find('=');
        const std::string name = volume.substr(0, equals);
        if (equals == std::string::npos || !IsShareName(name)) {
            fprintf(stderr, "zel_server: --volume takes NAME=FOLDER, not '%s'\n", volume.c_str());
            return kUsage;
        }
        config.volumes[name] = volume.substr(equals + 1);
    }
    // A server in a folder of its own leaves the machine's users alone.
    if (is_system) {
        config.user = options.user.empty() ? kStorageUser : options.user;
        if (!HaveStorageUser(config.user)) {
            return Fail("cannot make the system user '" + config.user + "' that owns the copies");
        }
    }
    std::string failed;
    if (!MakeFolders(failed)) {
        return Fail("cannot make " + failed);
    }
    int result = TakeFolder(config.storage);
    for (const auto& volume : config.volumes) {
        result = result == kOk ? TakeFolder(volume.second) : result;
    }
    if (result != kOk) {
        return result;
    }
    if (!SaveServerConfig(config) || !WriteRsyncdConfig(config)) {
        return FailErrno("cannot write the configuration in " + ConfigFolder());
    }
    if (TARQUISetZEL(1, nullptr, nullptr) != 0) {
        return Fail("cannot write the registry " + RegistryFile());
    }
    printf("Written: %s\n         (your own modules go into %s)\n\nNext:\n", RsyncdConfig().c_str(),
           AdminModules().c_str());
    printf("  zel_server account add NAME     an account for each client\n  %s\n",
           StartCommand().c_str());
    printf("The server then listens on port %d.\n", config.port);
    if (is_system && ZEL::IsPathExist("/etc/rsyncd.conf")) {
        printf(
            "\n/etc/rsyncd.conf is left alone. If an rsync daemon of yours listens on the same "
            "port, move its modules "
            "into\n%s, or choose another --port.\n",
            AdminModules().c_str());
    }
    return kOk;
}

// ---- Switch and pairing ----

int SetSwitch(bool on) {
    const RegistryLock lock;
    if (!lock.Held() || TARQUISetZEL(on ? 1 : 0, nullptr, nullptr) != 0) {
        return Fail("cannot write the registry " + RegistryFile() +
                    ": is the server set up, and are you its owner?");
    }
    puts(on ? "The server accepts clients." : "The server refuses all clients.");
    return kOk;
}

int ResetPair() {
    const RegistryLock lock;
    Section pairing;
    if (!lock.Held() || ReadSection("PairedClientInfo", pairing) == ReadResult::kFailed) {
        return Fail("cannot read the registry " + RegistryFile());
    }
    if (pairing["clientID"] == kMultiSourceMarker) {
        puts("The server serves several clients already: nothing to do.");
        return kOk;
    }
    if (zel_svr_reset_pair() != 0) {
        return Fail("cannot write the registry " + RegistryFile());
    }
    puts("The server now serves several clients; the one that was paired stays paired.");
    return kOk;
}

// ---- What there is ----

class ServerStatus {
public:
    ServerStatus() : read_(zel_svr_get_status(&status_) == 0) {}
    ~ServerStatus() {
        if (read_) {
            zel_svr_put_status(&status_);
        }
    }
    ServerStatus(const ServerStatus&) = delete;
    ServerStatus& operator=(const ServerStatus&) = delete;

    bool Read() const { return read_; }
    bool Serving() const { return status_.enabled != 0; }
    bool Busy() const { return status_.busy != 0; }
    std::string Client() const { return status_.client_id != nullptr ? status_.client_id : ""; }

private:
    zel_svr_status status_ = {};
    bool read_;
};

int ShowStatus(bool as_json) {
    const auto config = LoadServerConfig();
    if (!config) {
        return Fail("not set up: run 'zel_server setup --storage FOLDER'");
    }
    const ServerStatus status;
    if (!status.Read()) {
        return Fail("cannot read the registry " + RegistryFile());
    }
    const bool several = status.Client() == kMultiSourceMarker;
    const std::string pairing = several                   ? "several clients"
                                : status.Client().empty() ? "none"
                                                          : status.Client();
    std::error_code error;
    const fs::space_info space = fs::space(config->storage, error);
    if (as_json) {
        const nlohmann::ordered_json object = {
            {"switched_on", IsSwitchedOn()},
            {"daemon_running", KAPICProcAliveByPidFile(PidFile().c_str()) != 0},
            {"serving", status.Serving()},
            {"busy", status.Busy()},
            {"paired", pairing},
            {"port", config->port},
            {"storage", config->storage},
            {"storage_there", IsStorageThere(config->storage)},
            {"free_bytes", error ? 0 : space.available}};
        puts(object.dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace).c_str());
        return kOk;
    }
    printf("Switch:   %s\n", IsSwitchedOn() ? "on" : "off");
    printf("Daemon:   %s\n",
           KAPICProcAliveByPidFile(PidFile().c_str()) != 0 ? "running" : "not running");
    printf("Serving:  %s\n", status.Serving() ? "yes" : "no");
    printf("Busy:     %s\n", status.Busy() ? "yes" : "no");
    printf("Paired:   %s\n", programs::Printable(pairing).c_str());
    printf("Port:     %d\n", config->port);
    printf("Storage:  %s (%s)\n", config->storage.c_str(),
           !IsStorageThere(config->storage) ? "NOT THERE"
           : error                          ? "free space unknown"
                   : (programs::HumanBytes(space.available) + " free").c_str());
    return kOk;
}

// The names behind `prefix` of all such sections; nothing, with the complaint made, when they
// cannot be read.
std::optional<std::vector<std::string>> NamesOf(const std::string& prefix) {
    const auto sections = SectionNames();
    if (!sections) {
        Fail("cannot read the registry " + RegistryFile());
        return std::nullopt;
    }
    std::vector<std::string> names;
    for (const std::string& section : *sections) {
        if (section.compare(0, prefix.size(), prefix) == 0) {
            names.push_back(section.substr(prefix.size()));
        }
    }
    return names;
}

int ListClients(bool as_json) {
    const auto clients = NamesOf("CLIENTID_");
    if (!clients) {
        return kFailed;
    }
    Table table({"CLIENT", "KNOWS THIS SERVER AS"});
    for (const std::string& client : *clients) {
        Section section;
        ReadSection("CLIENTID_" + client, section);
        table.Add({client, section["ServerName"]});
    }
    Section pairing;
    ReadSection("PairedClientInfo", pairing);
    if (!pairing["clientID"].empty() && pairing["clientID"] != kMultiSourceMarker) {
        table.Add({pairing["clientID"], pairing["serverName"]});
    }
    table.Print(as_json);
    return kOk;
}

std::string OutcomeOf(const ShareState& state) {
    if (!state.running_id.empty()) {
        return "being pushed";
    }
    if (state.last_result.empty()) {
        return "never pushed";
    }
    const auto time = programs::ParseNumber(state.last_time, std::numeric_limits<time_t>::max());
    const std::string when = time ? " " + programs::HumanTime(static_cast<int64_t>(*time)) : "";
    if (state.last_result == "0") {
        return "complete" + when;
    }
    return (state.last_result == kEndedByClient
                ? "not complete"
                : "not complete (rsync " + state.last_result + ")") +
           when;
}

int ListShares(bool as_json) {
    const auto shares = NamesOf("SHARE_");
    if (!shares) {
        return kFailed;
    }
    Table table({"SHARE", "CLIENT", "ACCOUNT", "STATE", "FOLDER"});
    for (const std::string& share : *shares) {
        ShareState state;
        ReadShare(share, state);
        table.Add({share, state.Owner(), state.account, OutcomeOf(state), state.path});
    }
    table.Print(as_json);
    return kOk;
}

int ReleaseShare(const std::string& share) {
    const RegistryLock lock;
    ShareState state;
    if (!lock.Held() || ReadShare(share, state) != ReadResult::kRead) {
        return Fail("there is no share '" + share + "': see 'zel_server shares'");
    }
    state.running_id.clear();
    state.complete_id.clear();
    state.account.clear();
    if (!WriteShare(share, state)) {
        return Fail("cannot write the registry " + RegistryFile());
    }
    printf(
        "Share '%s' belongs to nobody now; the next client and account that push it get it, copy "
        "included.\n",
        share.c_str());
    return kOk;
}

// ---- Accounts ----

int AddAccount(const std::string& name, const std::string& password_file) {
    if (!IsAccountName(name)) {
        fprintf(stderr,
                "zel_server: '%s' cannot be an account: use letters, digits and . _ - @ +, a "
                "letter or digit first\n",
                programs::Printable(name).c_str());
        return kUsage;
    }
    std::string error;
    const auto password =
        programs::ReadPassword(password_file, "Password for " + name + ": ", error);
    if (!password) {
        return Fail(error);
    }
    if (!SetAccount(name, *password)) {
        return FailErrno("cannot write " + SecretsFile() + " (is the server set up?)");
    }
    printf("Account '%s' may log in.\n", name.c_str());
    return kOk;
}

int DropAccount(const std::string& name) {
    if (!RemoveAccount(name)) {
        return errno == ENOENT ? Fail("there is no account '" + name + "'")
                               : FailErrno("cannot write " + SecretsFile());
    }
    printf("Account '%s' may no longer log in; its shares' copies stay.\n", name.c_str());
    return kOk;
}

int ListAccounts(bool as_json) {
    const auto names = Accounts();
    if (!names) {
        return FailErrno("cannot read " + SecretsFile());
    }
    Table table({"ACCOUNT"});
    for (const std::string& name : *names) {
        table.Add({name});
    }
    table.Print(as_json);
    return kOk;
}

}  // namespace

int RunCommandLine(int argc, char** argv) {
    CLI::App app{"The server of the shared-folder synchronisation: receives what clients push"};
    app.name("zel_server");
    programs::SpeakPlainly(app, true);
    app.require_subcommand(1);
    app.set_version_flag("--version", ZEL_VERSION, "Show the version");
    int result = kOk;
    bool as_json = false;
    const auto json_flag = [&](CLI::App* command) {
        command->add_flag("--json", as_json, "Write JSON, for programs");
    };

    SetupOptions setup;
    CLI::App* const setup_command =
        app.add_subcommand("setup", "Write the configuration of the rsync daemon");
    setup_command->add_option("--storage", setup.storage, "Folder that receives the shares")
        ->option_text("FOLDER")
        ->required();
    setup_command
        ->add_option("--volume", setup.volumes,
                     "Another folder, for clients whose volume has that name")
        ->option_text("NAME=FOLDER");
    setup_command->add_option("--port", setup.port, "Port to listen on")
        ->default_str("873, with TARQ_ROOT 8873")
        ->check(programs::Between(1, 65535));
    setup_command->add_option("--address", setup.address, "Address to listen on")
        ->default_str("all");
    setup_command->add_option("--user", setup.user, "System user that owns the copies, as root")
        ->default_str("zel");
    setup_command->add_flag("--no-encryption", setup.no_encryption, "Refuse encrypted shares");
    setup_command->callback([&] { result = Setup(setup); });

    app.add_subcommand("enable", "Accept clients")->callback([&] { result = SetSwitch(true); });
    app.add_subcommand("disable", "Refuse all clients")->callback([&] {
        result = SetSwitch(false);
    });
    app.add_subcommand("reset-pair", "Turn a single pairing into one of several")->callback([&] {
        result = ResetPair();
    });

    CLI::App* const status = app.add_subcommand("status", "Show whether the server serves");
    json_flag(status);
    status->callback([&] { result = ShowStatus(as_json); });
    CLI::App* const clients = app.add_subcommand("clients", "List the paired clients");
    json_flag(clients);
    clients->callback([&] { result = ListClients(as_json); });

    std::string released;
    CLI::App* const shares = app.add_subcommand("shares", "List the shares, or release one");
    json_flag(shares);
    shares->add_option("--release", released, "Let another client or account take this share over")
        ->option_text("SHARE");
    shares->callback(
        [&] { result = released.empty() ? ListShares(as_json) : ReleaseShare(released); });

    std::string name;
    std::string password_file;
    CLI::App* const account = app.add_subcommand("account", "Accounts that may log in");
    account->require_subcommand(1);
    CLI::App* const add = account->add_subcommand("add", "Add an account, or change its password");
    add->add_option("name", name, "The account")->required();
    add->add_option("--password-file", password_file,
                    "File with the password ('-': standard input)");
    add->callback([&] { result = AddAccount(name, password_file); });
    CLI::App* const remove = account->add_subcommand("rm", "Remove an account");
    remove->add_option("name", name, "The account")->required();
    remove->callback([&] { result = DropAccount(name); });
    CLI::App* const list = account->add_subcommand("list", "List the accounts");
    json_flag(list);
    list->callback([&] { result = ListAccounts(as_json); });

    // The rsync daemon calls these three; main() takes them before it comes here.
    app.footer(
        "The rsync daemon itself calls 'handle-command', 'admit-transfer' and\n"
        "'end-transfer'.\n"
        "Exit codes: 0 done, 1 failed, 2 wrong usage.");
    const int ended = programs::Parse(app, programs::CommandWords(argc, argv), kUsage);
    return ended >= 0 ? ended : result;
}
