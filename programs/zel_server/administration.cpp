// The admin's command line, and the commands that are short enough to be implemented here.
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <limits>
#include <nlohmann/json.hpp>

#include "ZEL/is_syncedshare.h"
#include "base/rsync_config.h"
#include "base/text.h"
#include "programs/common/command_line.h"
#include "programs/common/failure.h"
#include "programs/common/help.h"
#include "programs/common/json_text.h"
#include "programs/common/table.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/adopt_copy.h"
#include "programs/zel_server/clients.h"
#include "programs/zel_server/connections.h"
#include "programs/zel_server/deposits.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/registry_repair.h"
#include "programs/zel_server/serve.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/setup.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/status.h"
#include "programs/zel_server/version_report.h"
#include "programs/zel_server/version_retention.h"
#include "programs/zel_server/version_turn.h"
#include "tarq/core.h"

namespace {

using Json = nlohmann::ordered_json;
using programs::Failure;
using programs::FailureKind;
using programs::SystemFailure;
using programs::Table;
using namespace zel_server;

Failure RegistryFailure(const char* what) {
    return Failure(std::string("cannot ") + what + " the registry " + RegistryFile() + ": " +
                   KAPICErrText(KAPICErrGet()));
}

// ---- Switch ----

// In the registry, which is authoritative, and in the configuration, in case the registry is lost.
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
    const auto damage = lock.Held() && TakeOverOldModules() ? FindDamage() : std::nullopt;
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

// ---- Listings ----

void ListClients(bool as_json) {
    const auto clients = PairedClients();
    if (!clients) {
        throw RegistryFailure("read");
    }
    Table table({"CLIENT", "KNOWS THIS SERVER AS", "ACCOUNTS"});
    for (const PairedClient& client : *clients) {
        std::string accounts;
        for (const std::string& account : client.accounts) {
            accounts += (accounts.empty() ? "" : " ") + account;
        }
        table.Add({client.id, client.server_name, accounts});
    }
    table.Print(as_json);
}

// The state of a share: one word for programs, and a text for people.
struct Outcome {
    const char* word;
    const char* text;
    bool ended;  // whether the time of the last push is known
};

Outcome OutcomeOf(const std::string& share, const ShareState& state, bool damaged) {
    if (damaged) {
        return {"damaged", "damaged: run 'zel_server repair'", false};
    }
    if (IsBeingPushed(share)) {
        return {"running", "being pushed", false};
    }
    if (!state.running_id.empty()) {  // the client is gone, and no other has pushed since
        return {"incomplete", "not complete", true};
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

// The number of its last completed push, and since when the copy is the one that it is.
std::string CopyText(const CopyState& copy) {
    return copy.identity.empty() ? ""
                                 : "#" + std::to_string(copy.generation) + " since " +
                                       programs::HumanTime(copy.since);
}

void ListShares(bool as_json) {
    const auto names = KnownShares();
    if (!names) {
        throw RegistryFailure("read");
    }
    Table table({"SHARE", "CLIENT", "ACCOUNT", "STATE", "COPY", "FOLDER"});
    Json rows = Json::array();
    for (const std::string& name : *names) {
        ShareState state;
        const bool damaged = ReadShare(name, state) != ReadResult::kRead;
        const Outcome outcome = OutcomeOf(name, state, damaged);
        const CopyState copy = RecordedCopy(name);
        const auto status = base::ParseNumber(state.last_result, 255);
        const auto time = base::ParseNumber(state.last_time, std::numeric_limits<time_t>::max());
        if (as_json) {
            rows.push_back({{"share", name},
                            {"client", state.Owner()},
                            {"account", state.account},
                            {"state", outcome.word},
                            {"rsync_status", OrNull(status)},
                            {"time", OrNull(time)},
                            {"copy", copy.identity},
                            {"generation", copy.generation},
                            {"copy_since", copy.since},
                            {"folder", state.path}});
        } else {
            table.Add({name, state.Owner(), state.account, OutcomeText(outcome, status, time),
                       CopyText(copy), state.path});
        }
    }
    if (as_json) {
        puts(programs::JsonText(rows).c_str());
    } else {
        table.Print(false);
    }
}

// `read`: the result of reading its section.
void RequireShare(const std::string& share, ReadResult read) {
    if (read == ReadResult::kFailed) {
        throw RegistryFailure("read");
    }
    if (read == ReadResult::kMissing) {
        throw Failure("there is no share '" + programs::Printable(share) +
                      "': see 'zel_server shares'");
    }
}

void OpenShare(const std::string& share) {
    const ServerConfig config = RequireServerConfig();
    const RegistryLock lock;
    ShareState state;
    const ReadResult read = lock.Held() ? ReadShare(share, state) : ReadResult::kFailed;
    RequireShare(share, read);
    if (state.account.empty()) {
        throw Failure("share '" + programs::Printable(share) + "' belongs to no account" +
                      (read == ReadResult::kDamaged ? ": run 'zel_server repair'" : ""));
    }
    CloseSilentModules();
    const auto module = OpenForReading(config, share, state, state.Owner(), Access::kRead);
    if (!module) {
        throw SystemFailure("cannot open a module in " + OpenModules());
    }
    const std::string port = config.plain_port == base::kRsyncPort
                                 ? ""
                                 : "--port=" + std::to_string(config.plain_port) + " ";
    printf(
        "Share '%s' can be read until nothing has been read for ten minutes, with the password of\n"
        "account '%s':\n    rsync -aAX --numeric-ids %s%s@127.0.0.1::%s/ FOLDER/\n",
        programs::Printable(share).c_str(), state.account.c_str(), port.c_str(),
        state.account.c_str(), module->c_str());
}

void ReleaseShare(const std::string& share) {
    RequireServerConfig();
    if (const auto folder = UnrecordedFolderOf(share)) {
        AdoptCopy(*folder, "");
        return;
    }
    const RegistryLock lock;
    ShareState state;
    const ReadResult read = lock.Held() ? ReadShare(share, state) : ReadResult::kFailed;
    RequireShare(share, read);
    const auto record = ReadShareRecord(share);
    if (read == ReadResult::kDamaged && record) {
        state.module = record->module;
        state.path = record->path;
        state.last_result = kMended;
    }
    state.running_id.clear();
    state.complete_id.clear();
    state.account.clear();
    CloseShare(share, true);
    if (!WriteShare(share, state)) {
        throw RegistryFailure("write");
    }
    if (!WriteShareRecord(share, state, RecordedCopy(share))) {
        throw SystemFailure("cannot write the share's record in " + ShareRecords());
    }
    printf(
        "Share '%s' belongs to nobody now; the next client and account that push it get it, copy "
        "included.\n",
        programs::Printable(share).c_str());
}

// ---- Accounts ----

struct NewAccount {
    std::string name;
    std::string password_file;
    bool typed = false;  // prompt for the password
    bool reset = false;

    bool IsMade() const { return password_file.empty() && !typed; }
};

std::string PasswordFor(const NewAccount& account) {
    if (account.IsMade()) {
        return MakePassword();
    }
    std::string password;
    try {
        password =
            programs::ReadNewPassword(account.password_file, "Password for " + account.name + ": ");
    } catch (const Failure& failure) {
        throw Failure(failure.what());  // not a usage error of this program
    }
    if (!IsLongEnough(password)) {
        throw Failure(
            "a password has 10 to 255 characters; without --password and "
            "--password-file a good one is made");
    }
    return password;
}

std::vector<Account> RequireAccounts() {
    auto accounts = Accounts();
    if (!accounts) {
        throw SystemFailure("cannot read " + SecretsFile());
    }
    return *std::move(accounts);
}

void AddAccount(const NewAccount& account) {
    const std::string& name = account.name;
    if (!IsAccountName(name)) {
        throw Failure(FailureKind::kUsage,
                      "'" + programs::Printable(name) +
                          "' cannot be an account: use letters, digits and . _ - @ +, a letter or "
                          "digit first");
    }
    const std::vector<Account> accounts = RequireAccounts();
    const auto known = std::find_if(accounts.begin(), accounts.end(),
                                    [&](const Account& other) { return other.name == name; });
    const bool is_new = known == accounts.end();
    if (!is_new && account.password_file.empty() && !account.reset) {
        if (isatty(STDIN_FILENO) == 0) {
            throw Failure("there is an account '" + name +
                          "' already: --reset gives it another password");
        }
        if (!programs::Confirm("There is an account '" + name +
                               "': give it another password, so that clients with the old one are "
                               "refused?")) {
            throw Failure("nothing was changed");
        }
    }
    const std::string password = PasswordFor(account);
    if (!SetAccount(name, password)) {
        throw SystemFailure("cannot write " + SecretsFile() + " (is the server set up?)");
    }
    printf(is_new ? "Account '%s' may log in.\n"
                  : "Account '%s' was there already: it has the new password now, and the old one "
                    "no longer holds.\n",
           name.c_str());
    if (!is_new && !known->enabled) {
        printf("It is disabled: 'zel_server account enable %s' lets it log in.\n", name.c_str());
    }
    if (account.IsMade()) {
        printf("Password: %s\n(shown this once; it is what the client asks for)\n",
               password.c_str());
    }
}

// Throws Failure unless the account's line was changed.
void RequireChanged(const std::string& name, bool changed) {
    if (!changed) {
        throw errno == ENOENT ? Failure("there is no account '" + programs::Printable(name) + "'")
                              : SystemFailure("cannot write " + SecretsFile());
    }
}

// Called after the change, so that the account cannot log in again in the meantime.
std::string EndWhatRuns(const std::string& account) {
    const size_t ended = EndConnections(account);
    const RegistryLock lock;
    if (!lock.Held()) {
        throw SystemFailure("cannot close the shares of account '" + account + "'");
    }
    CloseAccount(account);
    return ended == 0 ? "" : " " + programs::Count(ended, "connection") + " ended.";
}

void DropAccount(const std::string& name) {
    RequireChanged(name, RemoveAccount(name));
    const std::string ended = EndWhatRuns(name);
    if (!RemoveDeposits(name)) {
        throw SystemFailure("cannot remove what clients of account '" + name + "' have deposited");
    }
    printf("Account '%s' may no longer log in; its shares' copies stay.%s\n", name.c_str(),
           ended.c_str());
}

void SwitchAccount(const std::string& name, bool enabled) {
    RequireChanged(name, EnableAccount(name, enabled));
    printf(enabled ? "Account '%s' may log in.%s\n"
                   : "Account '%s' may not log in until it is enabled; its password and its "
                     "shares' copies stay.%s\n",
           name.c_str(), enabled ? "" : EndWhatRuns(name).c_str());
}

void ListAccounts(bool as_json) {
    Table table({"ACCOUNT", "STATE"});
    for (const Account& account : RequireAccounts()) {
        table.Add({account.name, account.enabled ? "enabled" : "disabled"});
    }
    table.Print(as_json);
}

// ---- What clients have deposited ----

void ListDeposits(bool as_json) {
    Table table({"ACCOUNT", "CLIENT", "NAME", "DEPOSITED", as_json ? "BYTES" : "SIZE"});
    for (const Account& account : RequireAccounts()) {
        for (const Deposit& deposit : Deposits(account.name)) {
            table.Add(
                {account.name, deposit.client, deposit.name,
                 as_json ? std::to_string(deposit.time) : programs::HumanTime(deposit.time),
                 as_json ? std::to_string(deposit.bytes) : programs::HumanBytes(deposit.bytes)});
        }
    }
    table.Print(as_json);
}

void DropDeposits(const std::string& client, const std::string& account) {
    const std::vector<Deposit> all =
        IsAccountName(account) ? Deposits(account) : std::vector<Deposit>();
    if (std::none_of(all.begin(), all.end(),
                     [&](const Deposit& deposit) { return deposit.client == client; })) {
        throw Failure("client '" + programs::Printable(client) +
                      "' has deposited nothing with account '" + programs::Printable(account) +
                      "'");
    }
    const RegistryLock lock;
    if (!lock.Held() || !RemoveDeposits(account, client)) {
        throw SystemFailure("cannot remove what client '" + client + "' has deposited");
    }
    printf("What client '%s' had deposited with account '%s' is removed.\n", client.c_str(),
           account.c_str());
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
        app.add_subcommand("setup", "Configure the server, and have it run");
    setup_command
        ->add_option("--storage", setup.storage,
                     "Folder that receives the shares; a new server needs it")
        ->option_text("FOLDER");
    setup_command
        ->add_option("--volume", setup.volumes,
                     "Another folder, for clients whose volume has that name; NAME= takes it out")
        ->option_text("NAME=FOLDER");
    setup_command
        ->add_option("--port", setup.tls_port,
                     "Port for clients, with TLS (874; 8874 with TARQ_ROOT)")
        ->check(programs::Between(1, 65535));
    setup_command
        ->add_option("--plain-port", setup.plain_port,
                     "Port without TLS, for this machine and for ssh (873; 8873 with TARQ_ROOT)")
        ->check(programs::Between(1, 65535));
    setup_command->add_flag_function(
        "--plain,!--no-plain", [&](int64_t count) { setup.plain = count > 0; },
        "Serve the network without TLS as well, unprotected");
    setup_command
        ->add_option("--certificate", setup.certificate,
                     "PEM file with a certificate and its key, in place of the server's own")
        ->option_text("FILE");
    setup_command->add_option("--address", setup.address, "Address to listen on, or all");
    setup_command->add_option("--user", setup.user,
                              "System user that owns the copies, as root (zel)");
    setup_command->add_flag_function(
        "--encryption,!--no-encryption", [&](int64_t count) { setup.encryption = count > 0; },
        "Accept or refuse encrypted shares");
    setup_command->add_flag_function(
        "--no-attributes,!--attributes",
        [&](int64_t count) { setup.without_attributes = count > 0; },
        "Take storage that cannot keep owners and modes, or refuse it");
    setup_command
        ->add_option("--keep", setup.keep,
                     "How long versions are kept: all of them, then one a day, one a week "
                     "(all=1d,daily=30d,weekly=1y)")
        ->option_text("PERIODS");
    setup_command
        ->add_option("--keep-at-least", setup.keep_at_least,
                     "Younger versions are not given up when the disk is nearly full (7d)")
        ->option_text("AGE");
    setup_command
        ->add_option("--reserve", setup.reserve,
                     "Percent of the disk below which older versions are given up (10)")
        ->check(programs::Between(0, kMaxReserve));
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
    bool without_front = false;
    CLI::App* const serve = app.add_subcommand("serve", "Serve in the foreground, as the units do");
    serve->add_flag("--without-front", without_front, "HAProxy is run by a unit of its own");
    serve->callback([&] { Serve(!without_front); });
    app.add_subcommand("front", "Run HAProxy in the foreground, as its unit does")->callback([] {
        RunFront();
    });

    CLI::App* const status = app.add_subcommand("status", "Show whether the server serves");
    json_flag(status);
    status->callback([&] { ShowStatus(as_json); });
    CLI::App* const clients = app.add_subcommand("clients", "List the paired clients");
    json_flag(clients);
    clients->callback([&] { ListClients(as_json); });

    std::string depositor;
    std::string deposit_account;
    CLI::App* const deposits = app.add_subcommand(
        "deposits", "List the configurations that clients have left here, or remove a client's");
    json_flag(deposits);
    CLI::Option* const remove =
        deposits->add_option("--remove", depositor, "Remove those of this client")
            ->option_text("CLIENT");
    CLI::Option* const deposited_by =
        deposits->add_option("--account", deposit_account, "Which it left with this account")
            ->option_text("NAME")
            ->needs(remove);
    remove->needs(deposited_by);
    deposits->callback([&] {
        depositor.empty() ? ListDeposits(as_json) : DropDeposits(depositor, deposit_account);
    });

    std::string opened;
    std::string released;
    std::string adopted;
    std::string adopter;
    CLI::App* const shares =
        app.add_subcommand("shares", "List the shares, open one for reading, release or adopt one");
    json_flag(shares);
    CLI::Option* const open =
        shares->add_option("--open", opened, "Open this share for its account, to get files back")
            ->option_text("SHARE");
    shares->add_option("--release", released, "Let another client or account take this share over")
        ->option_text("SHARE")
        ->excludes(open);
    CLI::Option* const adopt =
        shares
            ->add_option("--adopt", adopted,
                         "Take a folder of which nothing is recorded for the copy of the share of "
                         "its name")
            ->option_text("FOLDER")
            ->excludes(open);
    shares->add_option("--account", adopter, "The account to which that copy belongs")
        ->option_text("NAME")
        ->needs(adopt);
    shares->callback([&] {
        !opened.empty()     ? OpenShare(opened)
        : !released.empty() ? ReleaseShare(released)
        : !adopted.empty()  ? AdoptCopy(adopted, adopter)
                            : ListShares(as_json);
    });

    std::string versions_share;
    CLI::App* const versions =
        app.add_subcommand("versions", "Show what is kept of files that were replaced or deleted");
    versions->add_option("share", versions_share, "The share; without it, a line for each");
    json_flag(versions);
    versions->callback([&] { ShowVersions(versions_share, as_json); });
    // `serve` runs it now and then.
    bool for_space = false;
    CLI::App* const keep =
        app.add_subcommand("keep-versions", "Give up versions that are older than they are kept");
    keep->add_flag("--space", for_space, "Only those whose space is needed");
    keep->callback([&] { for_space ? GiveUpForSpace() : KeepVersions(); });

    NewAccount account;
    CLI::App* const accounts = app.add_subcommand("account", "Accounts that may log in");
    accounts->require_subcommand(1);
    const auto account_command = [&](const char* word, const char* help) {
        CLI::App* const command = accounts->add_subcommand(word, help);
        command->add_option("name", account.name, "The account")->required();
        return command;
    };
    CLI::App* const add =
        account_command("add", "Add an account, or change its password; a password is made for it");
    CLI::Option* const file = add->add_option("--password-file", account.password_file,
                                              "File with the password ('-': standard input)");
    add->add_flag("--password", account.typed, "Ask for the password")->excludes(file);
    add->add_flag("--reset", account.reset, "Do not ask before an account gets another password");
    add->callback([&] { AddAccount(account); });
    account_command("rm", "Remove an account, and end what it does")->callback([&] {
        DropAccount(account.name);
    });
    account_command("disable", "Keep an account, but let it log in no more, and end what it does")
        ->callback([&] { SwitchAccount(account.name, false); });
    account_command("enable", "Let a disabled account log in again")->callback([&] {
        SwitchAccount(account.name, true);
    });
    CLI::App* const list = accounts->add_subcommand("list", "List the accounts");
    json_flag(list);
    list->callback([&] { ListAccounts(as_json); });

    // The rsync daemon calls these four; main() handles them before this parser.
    app.footer(
        "The rsync daemon itself calls 'handle-command', 'begin-push',\n"
        "'admit-transfer' and 'end-transfer'.\n"
        "Exit codes: 0 done, 1 failed, 2 wrong usage.");
    return programs::RunReporting(
        "zel_server", [&] { programs::Parse(app, programs::CommandWords(argc, argv)); });
}
