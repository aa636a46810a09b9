// The servers that somebody has said how to reach, and by what to know: the file
// /usr/tarq/etc/tarqrsync_servers, a section a server. RsyncWrapper reaches a server that stands
// there in that way alone, whatever its setters say; one that does not stand there, as they say.
//
//     [nas.example.org]
//     transport="tls"
//     port="874"
//     fingerprint="SHA256:kN0r5vwWJFc1xTzBSX8hhxm2M8qAcLhUuZoP9a6UzVE"
//
// The file holds no secret, but all trust: it is read only where nobody but root and this process's
// own user may write it. The host keys of servers that are reached through ssh stand beside it, in
// /usr/tarq/etc/tarqrsync_known_hosts, by the same name.
#pragma once

#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace TARQ {
namespace Backup {

#pragma GCC visibility push(default)

/// How a server's rsync daemon is reached.
enum class ServerTransport {
    TLS,   ///< TLS 1.3 to a proxy in front of it, which is known by its public key
    SSH,   ///< through an ssh login, whose server is known by its host key
    PLAIN  ///< as it is: whoever is on the way may read and change what travels
};

/// A server of the file.
struct RsyncServer {
    std::string host;  ///< as people write it, see ServerName()
    ServerTransport transport = ServerTransport::TLS;
    int port = 0;  ///< 0: the transport's own: 874, 22, or the rsync daemon's configured one
    /// "SHA256:" and, in base64 without padding, the SHA-256 of the key: of the DER public key
    /// (SubjectPublicKeyInfo) with TLS, of the host key as ssh counts it with ssh; empty with
    /// neither.
    std::string fingerprint;
};

/// The key that an ssh server shows.
struct SshHostKey {
    std::string key;          ///< "ssh-ed25519 AAAA...", as it stands behind a name in known_hosts
    std::string fingerprint;  ///< "SHA256:..."
};

/// What the file says cannot be used, or it cannot be read or written, or a server did not show its
/// key: what() says where, what is wrong, and what to do.
class ServersError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

/// The file's path, below the root folder.
std::string ServersPath();

/// The name that stands for `host` in the file: in lower case, an IPv6 address in its shortest
/// form.
std::string ServerName(const std::string& host);

/// Whether `host` is this machine itself: 127.0.0.0/8, ::1 or localhost. Nobody is on the way
/// there.
bool IsLoopbackHost(const std::string& host);

/// Whether `text` has the form of a fingerprint: "SHA256:" and 43 characters of base64.
bool IsFingerprint(const std::string& text);

/// "tls", "ssh" or "plain", as the file has it.
const char* TransportWord(ServerTransport transport);

/// The port of a server that names none. Throws ServersError when the configuration that names the
/// rsync daemon's is faulty.
int DefaultServerPort(ServerTransport transport);

/// The server that stands in the file for `host`; none when it does not. Throws ServersError also
/// for a fault anywhere else in the file: a server whose section is damaged must not look like one
/// that nobody has named.
std::optional<RsyncServer> FindServer(const std::string& host);

/// All servers, in the file's order. Throws ServersError.
std::vector<RsyncServer> ListServers();

/// Writes the server into the file, in the place of what stands there for its host. With ssh,
/// `host_key` is from then on the one key that is taken from it; it goes into known_hosts first.
/// Atomic, and locked against other writers, who are waited for ten seconds at most. Throws
/// ServersError.
void TrustServer(const RsyncServer& server, const std::optional<SshHostKey>& host_key = {});

/// Takes the server, and its host key, out of the files. False when it was not there. Throws as
/// TrustServer() does.
bool ForgetServer(const std::string& host);

/// The fingerprint of the public key that a TLS server at `address` shows now. The caller has to
/// check it: nothing else is checked, and nothing but the handshake is sent. `cancelled` (may be
/// empty) is asked several times a second. Throws ServersError, also when it takes longer than
/// `seconds`.
std::string FetchFingerprint(const std::string& address, int port, int seconds,
                             const std::function<bool()>& cancelled = nullptr);

/// The host key that an ssh server at `address` shows now, reached as RsyncWrapper would (see the
/// configuration's `ssh` and `ssh_options`): the one that ssh prefers, or the one with
/// `fingerprint` when that is not empty and the server has it. The caller has to check it; no login
/// is tried. Time and failures as with FetchFingerprint().
SshHostKey FetchHostKey(const std::string& address, int port, const std::string& fingerprint,
                        int seconds, const std::function<bool()>& cancelled = nullptr);

/// The host key that is kept for `host`; none when there is none. Throws ServersError.
std::optional<SshHostKey> FindHostKey(const std::string& host);

#pragma GCC visibility pop

}  // namespace Backup
}  // namespace TARQ
