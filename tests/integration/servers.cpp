#include "tests/integration/servers.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <pwd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <thread>

#include "base/child_process.h"
#include "base/unique_fd.h"

namespace test {

namespace fs = std::filesystem;
using std::chrono::milliseconds;
using std::chrono::steady_clock;

namespace {

constexpr milliseconds kStartLimit(10000);
// No program that a test runs to its end takes so long, on the busiest machine either.
constexpr std::chrono::seconds kRunLimit(200);
constexpr milliseconds kStep(5);

sockaddr_in Loopback(int port) {
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return address;
}

bool Answers(int port) {
    const base::UniqueFd socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_in address = Loopback(port);
    return connect(socket.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
}

base::ChildSetup SetupOf(const std::vector<std::string>& command) {
    base::ChildSetup setup;
    setup.program = base::FindProgram(command[0], kSearchPath);
    setup.arguments = command;
    setup.environment = {"LC_ALL=C", std::string("PATH=") + kSearchPath};
    return setup;
}

void MakeKey(const std::string& path, const std::string& passphrase) {
    std::error_code ignored;
    fs::remove(path, ignored);
    Must(RunProgram("", {"ssh-keygen", "-q", "-t", "ed25519", "-N", passphrase, "-f", path}));
}

}  // namespace

Outcome RunProgram(const std::string& root, std::vector<std::string> command,
                   const std::string& input, const std::function<bool()>& cancelled,
                   const std::string& path) {
    base::ChildSetup setup = SetupOf(command);
    setup.environment = {"LC_ALL=C", "TARQ_ROOT=" + root, "PATH=" + path};
    setup.input = input;
    Outcome outcome;
    const auto append = [&](const char* bytes, size_t size) { outcome.output.append(bytes, size); };
    const auto limit = steady_clock::now() + kRunLimit;
    const auto is_over = [&] { return (cancelled && cancelled()) || steady_clock::now() > limit; };
    const base::ChildResult result = base::RunChild(setup, is_over, append, append);
    if (result.cancelled && steady_clock::now() > limit) {
        std::string words;
        for (const std::string& word : command) {
            words += word + " ";
        }
        throw std::runtime_error(words + "does not end: " + outcome.output);
    }
    outcome.exit_code = WIFEXITED(result.wait_status) ? WEXITSTATUS(result.wait_status) : -1;
    return outcome;
}

bool Await(const std::function<bool()>& condition, int seconds) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    while (!condition()) {
        if (std::chrono::steady_clock::now() > end) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

void Must(const Outcome& outcome) {
    if (outcome.exit_code != 0) {
        throw std::runtime_error(outcome.output);
    }
}

void ServerProcess::Start(const std::vector<std::string>& command, const std::string& log,
                          int port) {
    stop_ = ended_ = false;
    runner_ = std::thread([this, command, log] {
        std::ofstream file(log, std::ios::app);
        const auto append = [&file](const char* bytes, size_t size) {
            file.write(bytes, static_cast<std::streamsize>(size)).flush();
        };
        base::RunChild(
            SetupOf(command), [this] { return stop_.load(); }, append, append);
        ended_ = true;
    });
    const auto limit = steady_clock::now() + kStartLimit;
    while (!Answers(port)) {
        if (ended_ || steady_clock::now() > limit) {
            Stop();
            throw std::runtime_error(command[0] + " does not run: " + ReadFile(log));
        }
        std::this_thread::sleep_for(kStep);
    }
}

void ServerProcess::Stop() {
    if (runner_.joinable()) {
        stop_ = true;
        runner_.join();
    }
}

int FreePort() {
    const base::UniqueFd socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address = Loopback(0);
    socklen_t size = sizeof address;
    if (bind(socket.Get(), reinterpret_cast<const sockaddr*>(&address), size) != 0 ||
        getsockname(socket.Get(), reinterpret_cast<sockaddr*>(&address), &size) != 0) {
        throw std::runtime_error("no free port");
    }
    return ntohs(address.sin_port);
}

TricklingServer::TricklingServer(int port, const char* address, bool tls)
    : listener_(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
    sockaddr_in own = Loopback(port);
    inet_pton(AF_INET, address, &own.sin_addr);
    if (bind(listener_.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof own) != 0 ||
        listen(listener_.Get(), 64) != 0) {
        throw std::runtime_error("cannot listen");
    }
    thread_ = std::thread([this, tls] {
        // Lets everybody in, and has rsync print what it prints when a copy has begun.
        const auto message = [](const std::string& text) {
            return std::string{static_cast<char>(text.size()), 0, 0, 9} + text;
        };
        const std::string handshake("\x16\x03\x03\x40\0", 5);  // 16 KiB of it are to come
        const std::string rsync_greeting = "@RSYNCD: 31.0 md5\n@RSYNCD: OK\n" +
                                           std::string("\0seed", 5) +
                                           message("sending incremental file list\n");
        const std::string& greeting = tls ? handshake : rsync_greeting;
        const std::string byte = message(".");
        std::vector<base::UniqueFd> clients;
        for (; !stop_; std::this_thread::sleep_for(milliseconds(50))) {
            for (const base::UniqueFd& client : clients) {
                send(client.Get(), byte.data(), byte.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
            }
            base::UniqueFd client(accept4(listener_.Get(), nullptr, nullptr, SOCK_CLOEXEC));
            if (client) {
                send(client.Get(), greeting.data(), greeting.size(), MSG_NOSIGNAL);
                clients.push_back(std::move(client));
                ++clients_;
            }
        }
    });
}

TricklingServer::~TricklingServer() {
    stop_ = true;
    thread_.join();
}

RsyncDaemon::RsyncDaemon(const std::string& global_lines) : port_(FreePort()) {
    AddAccount(kUser, kPassword);
    const std::string configuration = folder_.Write(
        "rsyncd.conf", "use chroot = no\nsocket options = TCP_NODELAY\nreverse lookup = no\n" +
                           std::string(geteuid() == 0 ? "uid = 0\ngid = 0\n" : "") + global_lines +
                           "\n");
    process_.Start({"rsync", "--daemon", "--no-detach", "--config=" + configuration,
                    "--port=" + std::to_string(port_), "--address=127.0.0.1",
                    "--log-file=" + folder_.Path("log")},
                   folder_.Path("output"), port_);
}

void RsyncDaemon::AddAccount(const std::string& user, const std::string& password) {
    const std::string secrets = folder_.Path("secrets");
    std::ofstream(secrets, std::ios::app) << user << ":" << password << "\n";
    chmod(secrets.c_str(), 0600);
}

std::string RsyncDaemon::AddModule(const std::string& name, const std::string& lines) {
    const std::string path = folder_.Path("modules/" + name);
    fs::create_directories(path);
    std::ofstream(folder_.Path("rsyncd.conf"), std::ios::app)
        << "[" << name << "]\npath = " << path
        << "\nread only = no\nauth users = *\nsecrets file = " << folder_.Path("secrets") << "\n"
        << lines << "\n";
    return path;
}

void RsyncDaemon::AddCommandModule(const std::string& handler) {
    const std::string answers = folder_.Path("modules/zel_command");
    AddModule("zel_command",
              "read only = yes\nlist = no\nearly exec = ANSWERS='" + answers + "' exec " + handler);
}

TlsFront::TlsFront(int port_behind) : port_(FreePort()) {
    const std::string tls =
        ":" + std::to_string(port_) + " ssl crt " + folder_.Path("pem") + " ssl-min-ver TLSv1.3\n";
    folder_.Write("front.conf",
                  "defaults\n mode tcp\n timeout connect 5s\n timeout client 5s\n"
                  " timeout server 1h\n timeout tunnel 1h\nlisten front\n bind 127.0.0.1" +
                      tls + " bind ::1" + tls +
                      " server behind 127.0.0.1:" + std::to_string(port_behind) + "\n");
    Start();
}

void TlsFront::Start() {
    const std::string key = folder_.Path("key");
    const std::string certificate = folder_.Path("certificate");
    Must(RunProgram(
        "", {"openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256",
             "-nodes", "-days", "1", "-subj", "/CN=front", "-keyout", key, "-out", certificate}));
    folder_.Write("pem", ReadFile(key) + ReadFile(certificate));
    const Outcome digest =
        RunProgram("", {"sh", "-c",
                        "openssl pkey -in '" + key +
                            "' -pubout -outform der | openssl dgst -sha256 -binary | base64"});
    Must(digest);
    fingerprint_ = "SHA256:" + digest.output.substr(0, digest.output.find('='));
    process_.Start({"haproxy", "-db", "-f", folder_.Path("front.conf")}, folder_.Path("log"),
                   port_);
}

void TlsFront::ChangeKey() {
    process_.Stop();
    Start();
}

bool SshServer::Available() {
    return access(base::FindProgram("sshd", kSearchPath).c_str(), X_OK) == 0 &&
           (access("/run/sshd", X_OK) == 0 || mkdir("/run/sshd", 0755) == 0);
}

SshServer::SshServer(const std::string& passphrase) : port_(FreePort()) {
    MakeKey(folder_.Path("client"), "");
    MakeKey(folder_.Path("locked_client"), passphrase);
    folder_.Write("authorized_keys", ReadFile(folder_.Path("client.pub")) +
                                         ReadFile(folder_.Path("locked_client.pub")));
    MakeKey(folder_.Path("host"), "");
    folder_.Write("sshd_config",
                  "ListenAddress 127.0.0.1\nPort " + std::to_string(port_) + "\nHostKey " +
                      folder_.Path("host") + "\nAuthorizedKeysFile " +
                      folder_.Path("authorized_keys") +
                      "\nPidFile none\nStrictModes no\nUsePAM no\n"
                      "PermitRootLogin prohibit-password\nPasswordAuthentication no\n"
                      "KbdInteractiveAuthentication no\n");
    Start();
}

void SshServer::Start() {
    // sshd starts itself anew for each connection and wants its full path for that.
    process_.Start(
        {base::FindProgram("sshd", kSearchPath), "-D", "-e", "-f", folder_.Path("sshd_config")},
        folder_.Path("log"), port_);
}

void SshServer::ChangeHostKey() {
    process_.Stop();
    MakeKey(folder_.Path("host"), "");
    Start();
}

std::string SshServer::User() const {
    const passwd* entry = getpwuid(geteuid());
    return entry != nullptr ? entry->pw_name : "";
}

std::string SshServer::ClientKey(bool with_passphrase) const {
    return folder_.Path(with_passphrase ? "locked_client" : "client");
}

}  // namespace test
