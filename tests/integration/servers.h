// Real servers for tests: an rsync daemon and an ssh server on loopback, each with a folder and a
// free port of its own, ended with the object.
#pragma once

#include <atomic>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "base/unique_fd.h"
#include "tests/support/temp_root.h"

namespace test {

struct Outcome {
    int exit_code = -1;
    std::string output;  // both streams
};

constexpr char kSearchPath[] = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";

/// Runs a program to its end below a root folder; `cancelled`: ends it with SIGKILL in time.
Outcome RunProgram(const std::string& root, std::vector<std::string> command,
                   const std::string& input = "", const std::function<bool()>& cancelled = nullptr,
                   const std::string& path = kSearchPath);

/// Whether `condition` became true within a time that even a busy machine needs not.
bool Await(const std::function<bool()>& condition, int seconds = 60);

/// Throws what the program said when it has failed.
void Must(const Outcome& outcome);

/// A server program in the foreground. Ended, with what it has started, when destroyed or when the
/// test dies.
class ServerProcess {
public:
    ServerProcess() = default;
    ~ServerProcess() { Stop(); }
    ServerProcess(const ServerProcess&) = delete;
    ServerProcess& operator=(const ServerProcess&) = delete;

    /// Starts `command`, its output appended to the file `log`, and waits until `port` on loopback
    /// is answered. Throws when the program ends before, or takes too long.
    void Start(const std::vector<std::string>& command, const std::string& log, int port);
    void Stop();

private:
    std::thread runner_;
    std::atomic<bool> stop_{false};
    std::atomic<bool> ended_{false};
};

/// A TCP port of 127.0.0.1 that nobody listens on.
int FreePort();

/// Looks like an rsync daemon, or like a server with TLS, and then sends a few bytes now and then
/// for as long as somebody listens.
class TricklingServer {
public:
    explicit TricklingServer(int port, const char* address = "127.0.0.1", bool tls = false);
    ~TricklingServer();
    TricklingServer(const TricklingServer&) = delete;
    TricklingServer& operator=(const TricklingServer&) = delete;

    /// How many it keeps waiting, or has.
    int Clients() const { return clients_; }

private:
    base::UniqueFd listener_;
    std::atomic<int> clients_{0};
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

/// `rsync --daemon`. Configuration is read at each connection: modules may be added while it runs.
class RsyncDaemon {
public:
    static constexpr char kUser[] = "bob";
    static constexpr char kPassword[] = "pass word'\"$%";

    /// `global_lines`: added to the global part of the configuration.
    explicit RsyncDaemon(const std::string& global_lines = "");

    /// Lets one more account log in.
    void AddAccount(const std::string& user, const std::string& password);
    /// Adds a module for all accounts with a folder of its own, writable, below Folder(). `lines`
    /// are put behind the module's other lines, where they count in their place. Returns the
    /// folder.
    std::string AddModule(const std::string& name, const std::string& lines = "");
    /// Adds the module of server commands: `handler` (a program with arguments) gets each command
    /// on its standard input, with the folder of the answers in $ANSWERS and the module's variables
    /// of rsync.
    void AddCommandModule(const std::string& handler);

    int Port() const { return port_; }
    std::string Folder(const std::string& name = "") const { return folder_.Path(name); }
    /// What the daemon has logged.
    std::string Log() const { return ReadFile(folder_.Path("log")); }
    void Stop() { process_.Stop(); }

private:
    TempFolder folder_;
    int port_;
    ServerProcess process_;
};

/// A TLS 1.3 proxy on 127.0.0.1 and ::1, in front of a port of loopback, with a key of its own.
class TlsFront {
public:
    explicit TlsFront(int port_behind);

    /// Makes another key and starts again on the same port: the server that answers is another one.
    void ChangeKey();
    void Stop() { process_.Stop(); }

    int Port() const { return port_; }
    /// Of its key, as openssl counts it.
    std::string Fingerprint() const { return fingerprint_; }

private:
    void Start();

    TempFolder folder_;
    int port_;
    std::string fingerprint_;
    ServerProcess process_;
};

/// `sshd` that lets the user who runs the test log in with ClientKey().
class SshServer {
public:
    /// Whether this machine can run one for this user.
    static bool Available();

    /// `passphrase`: of the key that has one.
    explicit SshServer(const std::string& passphrase = "open 'sesame' $%");

    /// Makes a new host key and starts again on the same port: the server that answers is another
    /// one.
    void ChangeHostKey();

    int Port() const { return port_; }
    /// The user that may log in.
    std::string User() const;
    /// The file of a private key that the server takes; it has no passphrase, or the one given.
    std::string ClientKey(bool with_passphrase = false) const;
    std::string Log() const { return ReadFile(folder_.Path("log")); }

private:
    void Start();

    TempFolder folder_;
    int port_;
    ServerProcess process_;
};

}  // namespace test
