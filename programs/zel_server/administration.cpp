// What the admin types: the command line, and what is short enough to stand beside it.
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <limits>
#include <nlohmann/json.hpp>

#include "ZEL/is_syncedshare.h"
#include "base/text.h"
#include "programs/common/command_line.h"
#include "programs/common/failure.h"
#include "programs/common/help.h"
#include "programs/common/table.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/serve.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/setup.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/status.h"
#include "tarq/core.h"

namespace {

using Json = nlohmann::ordered_json;
using programs::Failure;
using programs::FailureKind;
using programs::SystemFailure;
using programs::Table;
using namespace zel_server;

constexpr char kMultiSourceMarker[] = "ZELMULTI-SRC-SUPPORT";

Failure RegistryFailure(const char* what) {
    return Failure(std::string("cannot ") + what + " the registry " + RegistryFile() + ": " +
                   KAPICErrText(KAPICErrGet()));
}

// ---- Switch ----

// In the registry, where it counts, and in the configuration, should the registry be lost.
void SetSwitch(bool on) {
    ServerConfig config = RequireServerConfig();
    const RegistryLock lock;
    if (!lock.Held() || TARQUISetZEL(on ? 1 : 0, nullptr, nullptr) != 0) {
        throw RegistryFailure("write");
    }
    config.switched_off = !on;
    if (!SaveServerConfig(config)) {
        throw SystemFailure("cannot write " + ConfigFile());
    }
    puts(on ? "The server accepts clients." : "The server refuses all clients.");
}

// ---- A damaged registry ----

void Repair() {
    const ServerConfig config = RequireServerConfig();
    const RegistryLock lock;
    const auto damage = lock.Held() ? FindDamage() : std::nullopt;
    if (!damage) {
        throw RegistryFailure("read");
    }
    if (damage->None()) {
        puts("The registry is whole: nothing to do.");
        return;
    }
    if (damage->switch_lost || !damage->shares.empty()) {
        if (!MendRegistry(*damage, config)) {
            throw SystemFailure("cannot write the registry " + RegistryFile());
        }
        printf("Mended:  %s with %s; the service is switched %s\n",
               programs::Count(damage->shares.size(), "share").c_str(),
               damage->shares.size() == 1 ? "its owner" : "their owners",
               ReadSwitch() == Switch::kOn ? "on" : "off");
        printf("Kept:    %s, the damaged file\n", DamagedCopy().c_str());
        puts("Clients that were forgotten pair again by themselves.");
    }
    for (const std::string& share : damage->ownerless) {
        printf(
            "Closed:  share '%s', as nothing tells to whom it belongs: 'zel_server shares "
            "--release' "
            "gives it to\n         the next client and account that push it\n",
            programs::Printable(share).c_str());
    }
    if (!damage->ownerless.empty()) {
        throw programs::ReportedFailure(FailureKind::kFailed);
    }
}

// ---- Pairing ----

void ResetPair() {
    const RegistryLock lock;
    Section pairing;
    if (!lock.Held() || ReadSection("PairedClientInfo", pairing) == ReadResult::kFailed) {
        throw RegistryFailure("read");
    }
    if (pairing["clientID"] == kMultiSourceMarker) {
        puts("The server serves several clients already: nothing to do.");
        return;
    }
    if (zel_svr_reset_pair() != 0) {
        throw RegistryFailure("write");
    }
    puts("The server now serves several clients; the one that was paired stays paired.");
}

// ---- What there is ----

void ListClients(bool as_json) {
    const auto sections = SectionNames();
    if (!sections) {
        throw RegistryFailure("read");
    }
    Table table({"CLIENT", "KNOWS THIS SERVER AS"});
    const std::string prefix = "CLIENTID_";
    for (const std::string& name : *sections) {
        if (name.compare(0, prefix.size(), prefix) == 0) {
            Section section;
            ReadSection(name, section);
            table.Add({name.substr(prefix.size()), section["ServerName"]});
        }
    }
    Section pairing;
    ReadSection("PairedClientInfo", pairing);
    if (!pairing["clientID"].empty() && pairing["clientID"] != kMultiSourceMarker) {
        table.Add({pairing["clientID"], pairing["serverName"]});
    }
    table.Print(as_json);
}

// How a share is: in a word for programs, and for people.
struct Outcome {
    const char* word;
    const char* text;
    bool ended;  // by a push whose time is known
};

Outcome OutcomeOf(const ShareState& state, bool damaged) {
    if (damaged) {
        return {"damaged", "damaged: run 'zel_server repair'", false};
    }
    if (!state.running_id.empty()) {
        return {"running", "being pushed", false};
    }
    if (state.last_result.empty()) {
        return {"new", "never pushed", false};
    }
    if (state.last_result == kMended) {
        return {"unknown", "not known until the next push", false};
    }
    return state.last_result == "0" ? Outcome{"complete", "complete", true}
                                    : Outcome{"incomplete", "not complete", true};
}

std::string OutcomeText(const Outcome& outcome, const std::optional<uint64_t>& status,
                        const std::optional<uint64_t>& time) {
    std::string text = outcome.text;
    if (outcome.ended && status && *status != 0) {
        text += " (rsync " + std::to_string(*status) + ")";
    }
    return outcome.ended && time ? text + " " + programs::HumanTime(static_cast<int64_t>(*time))
                                 : text;
}

Json OrNull(const std::optional<uint64_t>& number) {
    return number ? Json(*number) : Json(nullptr);
}

void ListShares(bool as_json) {
    const auto names = KnownShares();
    if (!names) {
        throw RegistryFailure("read");
    }
    Table table({"SHARE", "CLIENT", "ACCOUNT", "STATE", "FOLDER"});
    Json rows = Json::array();
    for (const std::string& name : *names) {
        ShareState state;
        const bool damaged = ReadShare(name, state) != ReadResult::kRead;
        const Outcome outcome = OutcomeOf(state, damaged);
        const auto status = base::ParseNumber(state.last_result, 255);
        const auto time = base::ParseNumber(state.last_time, std::numeric_limits<time_t>::max());
        if (as_json) {
            rows.push_back({{"share", name},
                            {"client", state.Owner()},
                            {"account", state.account},
                            {"state", outcome.word},
                            {"rsync_status", OrNull(status)},
                            {"time", OrNull(time)},
                            {"folder", state.path}});
        } else {
            table.Add({name, state.Owner(), state.account, OutcomeText(outcome, status, time),
                       state.path});
        }
    }
    if (as_json) {
        puts(rows.dump(2, ' ', false, Json::error_handler_t::replace).c_str());
    } else {
        table.Print(false);
    }
}

void ReleaseShare(const std::string& share) {
    const ServerConfig config = RequireServerConfig();
    const RegistryLock lock;
    ShareState state;
    const ReadResult read = lock.Held() ? ReadShare(share, state) : ReadResult::kFailed;
    if (read == ReadResult::kFailed) {
        throw RegistryFailure("read");
    }
    if (read == ReadResult::kMissing) {
        throw Failure("there is no share '" + programs::Printable(share) +
                      "': see 'zel_server shares'");
    }
    const auto module = ReadShareModule(share);
    if (read == ReadResult::kDamaged && module) {
        state.module = module->module;
        state.path = module->path;
        state.last_result = kMended;
    }
    state.running_id.clear();
    state.complete_id.clear();
    state.account.clear();
    if (!WriteShare(share, state)) {
        throw RegistryFailure("write");
    }
    if (!state.path.empty() && !WriteShareModule(config, share, state)) {
        throw SystemFailure("cannot write the module of the share in " + ShareModules());
    }
    printf(
        "Share '%s' belongs to nobody now; the next client and account that push it get it, copy "
        "included.\n",
        programs::Printable(share).c_str());
}

// ---- Accounts ----

std::string AskPassword(const std::string& name, const std::string& password_file) {
    try {
        return programs::ReadNewPassword(password_file, "Password for " + name + ": ");
    } catch (const Failure& failure) {
        throw Failure(failure.what());  // no wrong usage of this program
    }
}

void AddAccount(const std::string& name, const std::string& password_file, bool reset) {
    if (!IsAccountName(name)) {
        throw Failure(FailureKind::kUsage,
                      "'" + programs::Printable(name) +
                          "' cannot be an account: use letters, digits and . _ - @ +, a letter or "
                          "digit first");
    }
    const auto names = Accounts();
    if (!names) {
        throw SystemFailure("cannot read " + SecretsFile());
    }
    const bool is_new = std::find(names->begin(), names->end(), name) == names->end();
    const bool is_typed = password_file.empty() && isatty(STDIN_FILENO) != 0;
    if (!is_new && is_typed && !reset &&
        !programs::Confirm("There is an account '" + name +
                           "': give it another password, so that clients with the old one are "
                           "refused?")) {
        throw Failure("nothing was changed");
    }
    if (!SetAccount(name, AskPassword(name, password_file))) {
        throw SystemFailure("cannot write " + SecretsFile() + " (is the server set up?)");
    }
    printf(is_new ? "Account '%s' may log in.\n"
                  : "Account '%s' was there already: it has the new password now, and the old one "
                    "no longer holds.\n",
           name.c_str());
}

void DropAccount(const std::string& name) {
    if (!RemoveAccount(name)) {
        throw errno == ENOENT ? Failure("there is no account '" + name + "'")
                              : SystemFailure("cannot write " + SecretsFile());
    }
    printf("Account '%s' may no longer log in; its shares' copies stay.\n", name.c_str());
}

void ListAccounts(bool as_json) {
    const auto names = Accounts();
    if (!names) {
        throw SystemFailure("cannot read " + SecretsFile());
    }
    Table table({"ACCOUNT"});
    for (const std::string& name : *names) {
        table.Add({name});
    }
    table.Print(as_json);
}

}  // namespace

int RunCommandLine(int argc, char** argv) {
    CLI::App app{"The server of the shared-folder synchronisation: receives what clients push"};
    app.name("zel_server");
    programs::SpeakPlainly(app, true);
    app.require_subcommand(1);
    app.set_version_flag("--version", ZEL_VERSION, "Show the version");
    bool as_json = false;
    const auto json_flag = [&](CLI::App* command) {
        command->add_flag("--json", as_json, "Write JSON, for programs");
    };

    SetupOptions setup;
    CLI::App* const setup_command =
        app.add_subcommand("setup", "Configure the server, and have its rsync daemon run");
    setup_command
        ->add_option("--storage", setup.storage,
                     "Folder that receives the shares; a new server needs it")
        ->option_text("FOLDER");
    setup_command
        ->add_option("--volume", setup.volumes,
                     "Another folder, for clients whose volume has that name; NAME= takes it out")
        ->option_text("NAME=FOLDER");
    setup_command->add_option("--port", setup.port, "Port to listen on (873; 8873 with TARQ_ROOT)")
        ->check(programs::Between(1, 65535));
    setup_command->add_option("--address", setup.address, "Address to listen on, or all");
    setup_command->add_option("--user", setup.user,
                              "System user that owns the copies, as root (zel)");
    setup_command->add_flag_function(
        "--encryption,!--no-encryption", [&](int64_t count) { setup.encryption = count > 0; },
        "Accept or refuse encrypted shares");
    setup_command->footer("What is not given stays as it was.");
    setup_command->callback([&] { Setup(setup); });

    app.add_subcommand("enable", "Accept clients")->callback([&] { SetSwitch(true); });
    app.add_subcommand("disable", "Refuse all clients")->callback([&] { SetSwitch(false); });
    app.add_subcommand("reset-pair", "Turn a single pairing into one of several")->callback([&] {
        ResetPair();
    });

    app.add_subcommand("repair", "Put back what a damaged registry has lost")->callback([&] {
        Repair();
    });
    app.add_subcommand("serve", "Run the rsync daemon in the foreground, as the unit does")
        ->callback([&] { Serve(); });

    CLI::App* const status = app.add_subcommand("status", "Show whether the server serves");
    json_flag(status);
    status->callback([&] { ShowStatus(as_json); });
    CLI::App* const clients = app.add_subcommand("clients", "List the paired clients");
    json_flag(clients);
    clients->callback([&] { ListClients(as_json); });

    std::string released;
    CLI::App* const shares = app.add_subcommand("shares", "List the shares, or release one");
    json_flag(shares);
    shares->add_option("--release", released, "Let another client or account take this share over")
        ->option_text("SHARE");
    shares->callback([&] { released.empty() ? ListShares(as_json) : ReleaseShare(released); });

    std::string name;
    std::string password_file;
    CLI::App* const account = app.add_subcommand("account", "Accounts that may log in");
    account->require_subcommand(1);
    CLI::App* const add = account->add_subcommand("add", "Add an account, or change its password");
    add->add_option("name", name, "The account")->required();
    add->add_option("--password-file", password_file,
                    "File with the password ('-': standard input)");
    bool reset = false;
    add->add_flag("--reset", reset, "Do not ask before an account gets another password");
    add->callback([&] { AddAccount(name, password_file, reset); });
    CLI::App* const remove = account->add_subcommand("rm", "Remove an account");
    remove->add_option("name", name, "The account")->required();
    remove->callback([&] { DropAccount(name); });
    CLI::App* const list = account->add_subcommand("list", "List the accounts");
    json_flag(list);
    list->callback([&] { ListAccounts(as_json); });

    // The rsync daemon calls these three; main() takes them before it comes here.
    app.footer(
        "The rsync daemon itself calls 'handle-command', 'admit-transfer' and\n"
        "'end-transfer'.\n"
        "Exit codes: 0 done, 1 failed, 2 wrong usage.");
    return programs::RunReporting(
        "zel_server", [&] { programs::Parse(app, programs::CommandWords(argc, argv)); });
}
