// Which servers are trusted, by which key, and how they are reached (tarq/rsync_servers.h): decided
// once, by a person or a script.
#pragma once

#include <optional>
#include <string>

namespace CLI {
class App;
}

namespace zelctl {

/// What the command line specifies about reaching a server. By default: TLS, and a person is asked.
struct TrustWish {
    std::optional<bool> ssh;
    int port = 0;             ///< for TLS or ssh; 0: not given
    std::string fingerprint;  ///< of the server's key
    bool plain = false;

    bool IsEmpty() const { return !ssh && port == 0 && fingerprint.empty() && !plain; }
};

/// Declares the options --fingerprint and --plain.
void AddTrustOptions(CLI::App& command, TrustWish& wish);

bool IsTrusted(const std::string& server);

/// For a command that uses `server`: on first contact it fetches the server's key, which the person
/// at the terminal or `wish` has to confirm. A server that is already trusted is left as it is; the
/// local machine needs no trust unless `wish` asks for it. Throws Failure when there is no
/// confirmation, or when `wish` contradicts how the server is reached.
void MeetServer(const std::string& server, const TrustWish& wish);

/// Trusts the server "HOST" or "HOST:PORT" (an IPv6 address with a port: "[ADDRESS]:PORT") as given
/// by `wish`, and replaces any earlier entry.
void Trust(const std::string& host_and_port, TrustWish wish);

void ListTrust(bool as_json);
void ForgetTrust(const std::string& host);

}  // namespace zelctl
