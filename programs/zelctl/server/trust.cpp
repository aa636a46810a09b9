#include "programs/zelctl/server/trust.h"

#include <unistd.h>

#include <cstdio>
#include <vector>

#include "ZEL/zel.h"
#include "base/text.h"
#include "programs/common/failure.h"
#include "programs/common/help.h"
#include "programs/common/table.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/common/transport_words.h"
#include "programs/zelctl/base/prepare.h"
#include "tarq/rsync_servers.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using TARQ::Backup::RsyncServer;
using TARQ::Backup::ServersError;
using TARQ::Backup::ServerTransport;
using TARQ::Backup::SshHostKey;

constexpr int kPatience = 10;  // seconds, for each address of a server
constexpr uint64_t kMaxPort = 65535;

/// A key that a server has presented and nobody has confirmed yet.
struct ShownKey {
    std::string fingerprint;
    std::optional<SshHostKey> host_key;  ///< with ssh
};

// Converts errors of the platform's functions into local failures.
template <typename Action>
auto OnFiles(Action&& action) {
    try {
        return action();
    } catch (const ServersError& error) {
        throw Failure(FailureKind::kLocal, error.what());
    }
}

std::optional<RsyncServer> Find(const std::string& host) {
    return OnFiles([&] { return TARQ::Backup::FindServer(host); });
}

std::string CommandFor(const RsyncServer& server, const std::string& options) {
    const bool usual = server.port == TARQ::Backup::DefaultServerPort(server.transport);
    const bool bare = server.host.find(':') == std::string::npos;
    const std::string port = usual ? "" : ":" + std::to_string(server.port);
    return "zelctl trust " + (bare || usual ? server.host + port : "[" + server.host + "]" + port) +
           options;
}

const char* OptionOf(ServerTransport transport) {
    return transport == ServerTransport::SSH     ? " --ssh"
           : transport == ServerTransport::PLAIN ? " --plain"
                                                 : "";
}

// The key that the server presents now, at the first of its addresses that answers.
ShownKey Ask(const RsyncServer& server, const std::string& wanted) {
    std::vector<std::string> addresses;
    if (ZEL::GetUsableIP(server.host, "", addresses) != 0 || addresses.empty()) {
        throw Failure("no such server: the name " + Printable(server.host) +
                      " cannot be looked up");
    }
    std::string problem;
    for (const std::string& address : addresses) {
        try {
            if (server.transport == ServerTransport::SSH) {
                const SshHostKey key =
                    TARQ::Backup::FetchHostKey(address, server.port, wanted, kPatience);
                return {key.fingerprint, key};
            }
            return {TARQ::Backup::FetchFingerprint(address, server.port, kPatience), {}};
        } catch (const ServersError& error) {
            problem = error.what();
        }
    }
    const bool tls = server.transport == ServerTransport::TLS;
    throw Failure(problem +
                  (tls ? ". A server without TLS is reached through an ssh login (" +
                             CommandFor({server.host, ServerTransport::SSH, 22, ""}, " --ssh") +
                             ") or unprotected (zelctl trust " + server.host + " --plain)"
                       : ""));
}

void Write(const RsyncServer& server, const std::optional<SshHostKey>& key) {
    OnFiles([&] { TARQ::Backup::TrustServer(server, key); });
    printf("Server %s from now on: %s.\n", Printable(server.host).c_str(),
           programs::TransportWords(server).c_str());
    fflush(stdout);
}

std::string WhereToCompare(ServerTransport transport) {
    return transport == ServerTransport::SSH
               ? "'ssh-keygen -lf /etc/ssh/ssh_host_ed25519_key.pub' (or its like)"
               : "'zel_server status'";
}

void AskPerson(const RsyncServer& server, const std::optional<RsyncServer>& before) {
    const std::string name = Printable(server.host);
    fprintf(stderr, "%s\nThe server %s shows the %s key\n\n    %s\n\n",
            before ? ("Until now: " + programs::TransportWords(*before) + ".").c_str()
                   : ("Nobody has said yet how to know the server " + name + ".").c_str(),
            name.c_str(), server.transport == ServerTransport::SSH ? "ssh host" : "TLS",
            server.fingerprint.c_str());
    fprintf(stderr, "Compare it with what %s says at the server itself.\n",
            WhereToCompare(server.transport).c_str());
    if (!programs::Confirm("Is it the same?")) {
        throw Failure(FailureKind::kCancelled, "the server is not trusted; nothing was done");
    }
}

// Trusts the server, whose key is not known yet, once `wanted` or the person at the terminal
// confirms the key that it presents.
void TrustAs(RsyncServer server, const std::string& wanted,
             const std::optional<RsyncServer>& before) {
    PrepareHost();
    if (server.transport == ServerTransport::PLAIN) {
        Write(server, {});
        return;
    }
    const ShownKey shown = Ask(server, wanted);
    server.fingerprint = shown.fingerprint;
    const std::string options =
        std::string(OptionOf(server.transport)) + " --fingerprint " + shown.fingerprint;
    if (!wanted.empty() && wanted != shown.fingerprint) {
        throw Failure(FailureKind::kRefused,
                      "server " + Printable(server.host) + " shows the key " + shown.fingerprint +
                          ", not " + wanted + ": somebody may be in between, or it is another " +
                          "server; nothing was done");
    }
    if (wanted.empty()) {
        if (isatty(STDIN_FILENO) == 0) {
            throw Failure(FailureKind::kUsage,
                          "nobody to ask whether the key of server " + Printable(server.host) +
                              " is the right one. Compare it with what " +
                              WhereToCompare(server.transport) +
                              " says there; then: " + CommandFor(server, options));
        }
        AskPerson(server, before);
    }
    Write(server, shown.host_key);
}

RsyncServer Wanted(const std::string& host, const TrustWish& wish) {
    if (wish.plain && (wish.ssh.value_or(false) || !wish.fingerprint.empty())) {
        throw Failure(FailureKind::kUsage,
                      "--plain goes neither with --ssh nor with --fingerprint: it has no key");
    }
    if (!wish.fingerprint.empty() && !TARQ::Backup::IsFingerprint(wish.fingerprint)) {
        throw Failure(FailureKind::kUsage,
                      "--fingerprint must be SHA256: and 43 characters, as 'zel_server status' "
                      "prints it at the server");
    }
    RsyncServer server;
    server.host = TARQ::Backup::ServerName(host);
    server.transport = wish.plain                 ? ServerTransport::PLAIN
                       : wish.ssh.value_or(false) ? ServerTransport::SSH
                                                  : ServerTransport::TLS;
    server.port = wish.port;
    if (server.port == 0 && !wish.plain) {
        server.port = TARQ::Backup::DefaultServerPort(server.transport);
    }
    return server;
}

// Whether `known` is in agreement with everything that `wish` specifies.
bool Agrees(const RsyncServer& known, const TrustWish& wish) {
    const bool is_ssh = known.transport == ServerTransport::SSH;
    const int port =
        known.port != 0 ? known.port : TARQ::Backup::DefaultServerPort(known.transport);
    return (!wish.plain || known.transport == ServerTransport::PLAIN) &&
           (!wish.ssh || *wish.ssh == is_ssh) && (wish.port == 0 || wish.port == port) &&
           (wish.fingerprint.empty() || wish.fingerprint == known.fingerprint);
}

void SplitPort(const std::string& text, std::string& host, int& port) {
    const size_t colon = text.rfind(':');
    const bool bracketed = !text.empty() && text.front() == '[';
    const bool bare_address = !bracketed && text.find(':') != colon;
    host = text;
    if (colon != std::string::npos && !bare_address && text.back() != ']') {
        const auto number = base::ParseNumber(text.substr(colon + 1), kMaxPort);
        if (!number || *number == 0) {
            throw Failure(FailureKind::kUsage,
                          "'" + Printable(text.substr(colon + 1)) + "' is no port from 1 to 65535");
        }
        port = static_cast<int>(*number);
        host = text.substr(0, colon);
    }
    if (bracketed && host.size() > 2 && host.back() == ']') {
        host = host.substr(1, host.size() - 2);
    }
}

}  // namespace

void AddTrustOptions(CLI::App& command, TrustWish& wish) {
    command
        .add_option("--fingerprint", wish.fingerprint,
                    "The server's key, as 'zel_server status' prints it there; with --ssh its host "
                    "key. For a server that is not trusted yet: nobody is asked then")
        ->option_text("SHA256:KEY");
    command.add_flag("--plain", wish.plain,
                     "Unprotected: whoever is on the way to the server may read and change "
                     "everything");
}

bool IsTrusted(const std::string& server) {
    return Find(server).has_value();
}

void MeetServer(const std::string& server, const TrustWish& wish) {
    const RsyncServer wanted = Wanted(server, wish);
    const std::optional<RsyncServer> known = Find(server);
    if (!known) {
        const bool needs_trust = wish.ssh.value_or(false) || !wish.fingerprint.empty();
        if (needs_trust || !TARQ::Backup::IsLoopbackHost(server)) {
            TrustAs(wanted, wish.fingerprint, {});
        }
        return;
    }
    if (!Agrees(*known, wish)) {
        const std::string key =
            wish.fingerprint.empty() ? "" : " --fingerprint " + wish.fingerprint;
        throw Failure(
            FailureKind::kUsage,
            "server " + Printable(known->host) +
                " is reached in another way: " + programs::TransportWords(*known) +
                ". To change that: " + CommandFor(wanted, OptionOf(wanted.transport) + key));
    }
}

void Trust(const std::string& host_and_port, TrustWish wish) {
    std::string host;
    SplitPort(host_and_port, host, wish.port);
    const RsyncServer wanted = Wanted(host, wish);
    TrustAs(wanted, wish.fingerprint, Find(host));
}

void ListTrust(bool as_json) {
    programs::Table table({"SERVER", "TRANSPORT", "PORT", "KEY"});
    for (const RsyncServer& server : OnFiles(TARQ::Backup::ListServers)) {
        const bool plain = server.transport == ServerTransport::PLAIN;
        const int port = server.port != 0 ? server.port : OnFiles([&] {
            return TARQ::Backup::DefaultServerPort(server.transport);
        });
        table.Add({server.host, TARQ::Backup::TransportWord(server.transport), std::to_string(port),
                   plain && !as_json ? "none: unprotected" : server.fingerprint});
    }
    table.Print(as_json);
}

void ForgetTrust(const std::string& host) {
    if (!OnFiles([&] { return TARQ::Backup::ForgetServer(host); })) {
        throw Failure(FailureKind::kUsage, "there is no trusted server '" + Printable(host) + "'");
    }
    printf("Server %s is forgotten.\n", Printable(host).c_str());
}

}  // namespace zelctl
