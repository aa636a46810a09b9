#include "platform/tarqrsync/host_keys.h"

#include <sys/wait.h>

#include <chrono>
#include <cstring>
#include <vector>

#include "base/child_process.h"
#include "base/config_file.h"
#include "base/rsync_config.h"
#include "base/text.h"
#include "platform/tarqrsync/arguments.h"
#include "platform/tarqrsync/helper_program.h"
#include "platform/tarqrsync/known_hosts.h"
#include "platform/tarqrsync/private_folder.h"
#include "platform/tarqrsync/settings.h"
#include "tarq/root_path.h"
#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;
using Words = std::vector<std::string>;
using Cancelled = std::function<bool()>;

// The time for a local program that uses no network.
constexpr int kToolSeconds = 10;

// The kinds of host keys, each as HostKeyAlgorithms has it.
constexpr const char* kKinds[] = {"ssh-ed25519",
                                  "ecdsa-sha2-nistp256,ecdsa-sha2-nistp384,ecdsa-sha2-nistp521",
                                  "rsa-sha2-512,rsa-sha2-256"};
// Stands for the server in the file of known hosts that ssh writes for us.
constexpr char kAlias[] = "server";

struct ToolResult {
    bool succeeded = false;
    bool late = false;
    std::string output;
    std::string last_words;  // the last line of its complaints
};

std::string LastLine(const std::string& text) {
    const std::string_view all = base::Trimmed(text);
    const size_t before = all.rfind('\n');
    return std::string(base::Trimmed(all.substr(before == std::string::npos ? 0 : before + 1)));
}

ToolResult RunTool(const Words& command, const std::string& input, int patience,
                   const Cancelled& cancelled) {
    base::ChildSetup setup;
    setup.environment = BaseEnvironment();
    setup.program = base::FindProgram(command[0], SearchPath());
    setup.arguments = command;
    setup.input = input;
    if (setup.program.empty()) {
        throw ServersError("the program " + command[0] + " is not installed");
    }
    const auto until = steady_clock::now() + seconds(patience);
    ToolResult result;
    std::string errors;
    const base::ChildResult ended = base::RunChild(
        setup,
        [&] {
            result.late = steady_clock::now() >= until;
            return result.late || (cancelled && cancelled());
        },
        [&](const char* bytes, size_t size) { result.output.append(bytes, size); },
        [&](const char* bytes, size_t size) { errors.append(bytes, size); });
    if (ended.start_error != 0) {
        throw ServersError("the program " + command[0] +
                           " cannot be started: " + strerror(ended.start_error));
    }
    result.last_words = LastLine(errors);
    result.succeeded =
        !ended.cancelled && WIFEXITED(ended.wait_status) && WEXITSTATUS(ended.wait_status) == 0;
    return result;
}

[[noreturn]] void RefuseKey(const std::string& what, const std::string& address, int port,
                            int patience, ToolResult result) {
    constexpr std::string_view kOurs = "connect: ";
    if (result.last_words.compare(0, kOurs.size(), kOurs) == 0) {
        result.last_words.erase(0, kOurs.size());
    }
    throw ServersError(address + " did not show " + what + " on port " + std::to_string(port) +
                       ": " +
                       (result.late ? "no answer within " + std::to_string(patience) + " seconds"
                        : result.last_words.empty() ? "it was not asked to the end"
                                                    : result.last_words));
}

void CheckAddress(const std::string& address) {
    if (!IsHost(address)) {
        throw ServersError("'" + address + "' is neither a host name nor an address");
    }
}

// ssh asks for the kinds of host keys that `kinds` names, or for the one that it prefers.
std::optional<SshHostKey> AskForHostKey(const base::RsyncConfig& config, const std::string& address,
                                        int port, const char* kinds, int patience,
                                        const Cancelled& cancelled, ToolResult& result) {
    PrivateFolder folder;
    const std::string known = folder.Path("known_hosts");
    // The first value that ssh meets holds: here these, and then the configured ones.
    Words command = {config.ssh, "-T", "-p", std::to_string(port)};
    for (const std::string& option :
         Words{"StrictHostKeyChecking=accept-new", "UserKnownHostsFile=\"" + known + "\"",
               "GlobalKnownHostsFile=/dev/null", "HashKnownHosts=no", "UpdateHostKeys=no",
               std::string("HostKeyAlias=") + kAlias, "PreferredAuthentications=none",
               "BatchMode=yes", "ConnectTimeout=" + std::to_string(patience), "ControlPath=none",
               "LogLevel=ERROR"}) {
        command.insert(command.end(), {"-o", option});
    }
    if (kinds != nullptr) {
        command.insert(command.end(), {"-o", std::string("HostKeyAlgorithms=") + kinds});
    }
    command.insert(command.end(), config.ssh_options.begin(), config.ssh_options.end());
    command.insert(command.end(), {"--", address, "true"});
    result = RunTool(command, "", patience, cancelled);
    const std::optional<std::string> key = ReadKnownHost(known, kAlias);
    return key ? std::optional(SshHostKey{*key, FingerprintOfHostKey(*key)}) : std::nullopt;
}

}  // namespace

std::string FingerprintOfHostKey(const std::string& key) {
    // "256 SHA256:... comment (ED25519)"
    const ToolResult result =
        RunTool({"ssh-keygen", "-l", "-f", "-"}, key + "\n", kToolSeconds, nullptr);
    const size_t begin = result.output.find(' ');
    std::string fingerprint =
        begin == std::string::npos
            ? ""
            : result.output.substr(begin + 1, result.output.find(' ', begin + 1) - begin - 1);
    if (!result.succeeded || !IsFingerprint(fingerprint)) {
        throw ServersError("ssh-keygen cannot read the host key '" + key.substr(0, 40) +
                           "...': " + result.last_words);
    }
    return fingerprint;
}

std::string FetchFingerprint(const std::string& address, int port, int patience,
                             const Cancelled& cancelled) {
    CheckAddress(address);
    // The program has a time-out of its own, and reports what it was waiting for.
    const ToolResult result = RunTool({HelperProgram("connect"), "--show-key", address,
                                       std::to_string(port), std::to_string(patience)},
                                      "", patience + 1, cancelled);
    std::string fingerprint(base::Trimmed(result.output));
    if (!result.succeeded || !IsFingerprint(fingerprint)) {
        RefuseKey("a TLS key", address, port, patience, result);
    }
    return fingerprint;
}

SshHostKey FetchHostKey(const std::string& address, int port, const std::string& fingerprint,
                        int patience, const Cancelled& cancelled) {
    CheckAddress(address);
    const auto until = steady_clock::now() + seconds(patience);
    try {
        const base::RsyncConfig config = base::ReadRsyncConfig(RootPath(base::kRsyncConfigPath));
        ToolResult result;
        const std::optional<SshHostKey> preferred =
            AskForHostKey(config, address, port, nullptr, patience, cancelled, result);
        if (!preferred) {
            RefuseKey("an ssh host key", address, port, patience, result);
        }
        if (fingerprint.empty() || preferred->fingerprint == fingerprint) {
            return *preferred;
        }
        for (const char* kinds : kKinds) {
            const auto left = std::chrono::ceil<seconds>(until - steady_clock::now()).count();
            if (left <= 0) {
                break;
            }
            const std::optional<SshHostKey> key = AskForHostKey(
                config, address, port, kinds, static_cast<int>(left), cancelled, result);
            if (key && key->fingerprint == fingerprint) {
                return *key;
            }
        }
        return *preferred;
    } catch (const base::ConfigError& error) {
        throw ServersError(error.what());
    } catch (const PrivateFileError& error) {
        throw ServersError(error.what());
    }
}

}  // namespace Backup
}  // namespace TARQ
