#include "programs/zel_server/front.h"

#include <pwd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <sstream>

#include "base/replace_file.h"
#include "base/text.h"
#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "programs/zel_server/connections.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

constexpr size_t kMaxFile = 65536;
constexpr size_t kMaxCommandLine = 4096;
constexpr char kProgram[] = "/usr/sbin/haproxy";
constexpr char kUser[] = "haproxy";
constexpr char kLoopback[] = "127.0.0.1";
constexpr char kLoopback6[] = "::1";

bool HasIPv6() {
    return static_cast<bool>(base::UniqueFd(socket(AF_INET6, SOCK_STREAM | SOCK_CLOEXEC, 0)));
}

// Whether the front drops root privileges, which it needs only to listen.
bool HasUser() {
    return geteuid() == 0 && TARQ::RootFolder().empty();
}

std::pair<uid_t, gid_t> FrontIdentity() {
    if (access(kProgram, X_OK) != 0) {
        throw programs::Failure(std::string("HAProxy, which takes the connections, is missing (") +
                                kProgram + "): apt-get install haproxy");
    }
    if (!HasUser()) {
        return {geteuid(), getegid()};
    }
    const struct passwd* const user = getpwnam(kUser);
    if (user == nullptr) {
        throw programs::Failure(std::string("there is no user '") + kUser +
                                "', which HAProxy's package makes: apt-get install --reinstall "
                                "haproxy");
    }
    return {user->pw_uid, user->pw_gid};
}

double Seconds(const struct timespec& time) {
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

double SecondsOf(clockid_t clock) {
    struct timespec now = {};
    clock_gettime(clock, &now);
    return Seconds(now);
}

// The age of a process in seconds; nothing when there is no such process.
std::optional<double> AgeOf(pid_t pid) {
    const std::string stat =
        base::ReadFile("/proc/" + std::to_string(pid) + "/stat", kMaxCommandLine).value_or("");
    // The name, in parentheses, may contain anything. The start time is the 20th word after it.
    std::istringstream words(stat.substr(std::min(stat.rfind(')'), stat.size() - 1) + 1));
    std::string word;
    for (int i = 0; i < 20 && words >> word; ++i) {
    }
    const auto ticks = base::ParseNumber(word, UINT64_MAX);
    return words && ticks ? std::optional<double>(SecondsOf(CLOCK_BOOTTIME) -
                                                  static_cast<double>(*ticks) /
                                                      static_cast<double>(sysconf(_SC_CLK_TCK)))
                          : std::nullopt;
}

bool IsAmong(const std::vector<std::string>& texts, const std::string& text) {
    return std::find(texts.begin(), texts.end(), text) != texts.end();
}

// Writes one bind line for each address that the configured one resolves to.
void Bind(const Endpoint& endpoint, const std::string& options, std::ostream& text) {
    const std::string port = ":" + std::to_string(endpoint.port) + options + "\n";
    if (endpoint.address.empty()) {
        text << "    bind 0.0.0.0" << port;
        if (HasIPv6()) {
            text << "    bind [::]" << port;
        }
        return;
    }
    for (const std::string& address : NumericAddresses(endpoint.address)) {
        const bool is_ipv6 = address.find(':') != std::string::npos;
        text << "    bind " << (is_ipv6 ? "[" + address + "]" : address) << port;
    }
}

// The configured address if the network is served without TLS, and this machine's own addresses in
// any case.
std::vector<Endpoint> PlainEndpoints(const ServerConfig& config) {
    std::vector<Endpoint> plain;
    if (config.plain) {
        plain.push_back({config.address, config.plain_port});
    }
    const auto served =
        config.plain ? NumericAddresses(config.address) : std::vector<std::string>();
    if (!IsAmong(served, "0.0.0.0") && !IsAmong(served, kLoopback)) {
        plain.push_back({kLoopback, config.plain_port});
    }
    if (HasIPv6() && !IsAmong(served, "::") && !IsAmong(served, kLoopback6)) {
        plain.push_back({kLoopback6, config.plain_port});
    }
    return plain;
}

std::string ConfigText(const ServerConfig& config) {
    std::ostringstream text;
    text << "# Written at each start of the front. HAProxy takes the connections "
            "and hands them on.\n"
         << "global\n"
         << "    maxconn " << 2 * kMaxPerPort << "\n"
         << "    log stderr format raw daemon notice\n";
    if (HasUser()) {
        text << "    user " << kUser << "\n    group " << kUser << "\n";
    }
    // The short time-outs end clients that send nothing before the daemon is reached. The daemon
    // itself ends connections that do not log in or that stall. It knows better: a verification
    // reads a large file in silence, and its client has asked for the time that this takes.
    text << "\ndefaults\n"
         << "    mode tcp\n"
         << "    option dontlognull\n"
         << "    option clitcpka\n"
         << "    timeout connect 10s\n"
         << "    timeout client 20s\n"
         << "    timeout server 20s\n"
         << "    timeout tunnel " << kLongestSilence + 60 << "s\n"
         << "\nfrontend network\n"
         << "    maxconn " << kMaxPerPort << "\n";
    Bind({config.address, config.tls_port}, " ssl crt '" + FrontKey() + "' ssl-min-ver TLSv1.3",
         text);
    // Local connections, those of ssh included, all come from one address, so the limit per address
    // does not apply to them.
    text << "    stick-table type ipv6 size 100k expire 10m store conn_cur\n"
         << "    acl own src 127.0.0.0/8 ::1\n"
         << "    tcp-request connection track-sc0 src,ipmask(32,64) if !own\n"
         << "    tcp-request connection reject if !own { sc0_conn_cur gt " << kMaxPerAddress
         << " }\n"
         << "    default_backend rsyncd\n"
         << "\nfrontend plain\n"
         << "    maxconn " << kMaxPerPort << "\n";
    for (const Endpoint& endpoint : PlainEndpoints(config)) {
        Bind(endpoint, "", text);
    }
    text << "    acl own src 127.0.0.0/8 ::1\n"
         << "    tcp-request connection track-sc0 src,ipmask(32,64) table network if !own\n"
         << "    tcp-request connection reject if !own { sc0_conn_cur(network) gt "
         << kMaxPerAddress << " }\n"
         << "    default_backend rsyncd\n"
         << "\nbackend rsyncd\n"
         << "    server rsyncd 'unix@" << FrontSocket() << "' send-proxy-v2\n";
    return text.str();
}

}  // namespace

std::vector<Endpoint> Endpoints(const ServerConfig& config) {
    std::vector<Endpoint> all = PlainEndpoints(config);
    all.insert(all.begin(), {config.address, config.tls_port});
    return all;
}

std::vector<std::string> PrepareFront(const ServerConfig& config) {
    HaveFrontKey();
    const std::string text = ConfigText(config);
    if (base::ReadFile(FrontConfig(), kMaxFile) != text &&
        !base::ReplaceFile(FrontConfig(), text, 0640)) {
        throw programs::SystemFailure("cannot write " + FrontConfig());
    }
    // With -Ws, HAProxy notifies the service manager once it listens.
    return {kProgram, getenv("NOTIFY_SOCKET") != nullptr ? "-Ws" : "-db", "-f", FrontConfig()};
}

bool IsOurFront(pid_t pid) {
    const auto words = base::ReadFile("/proc/" + std::to_string(pid) + "/cmdline", kMaxCommandLine);
    return words && words->find('\0' + FrontConfig() + '\0') != std::string::npos;
}

bool IsOutdated(const ServerConfig& config, pid_t front) {
    // The kernel counts the start of a process in clock ticks of 10 ms; this leaves a margin.
    constexpr double kStep = 0.1;
    struct stat key = {};
    const std::optional<double> age = AgeOf(front);
    const bool key_is_newer = age && stat(FrontKey().c_str(), &key) == 0 &&
                              SecondsOf(CLOCK_REALTIME) - Seconds(key.st_mtim) + kStep < *age;
    return key_is_newer || base::ReadFile(FrontConfig(), kMaxFile) != ConfigText(config);
}

std::vector<Listener> Listeners(const ServerConfig& config) {
    std::vector<Listener> all = ListenersOn(config.tls_port);
    if (config.plain_port != config.tls_port) {
        const std::vector<Listener> plain = ListenersOn(config.plain_port);
        all.insert(all.end(), plain.begin(), plain.end());
    }
    return all;
}

bool ServesAll(const ServerConfig& config, const std::vector<Listener>& listeners) {
    for (const Endpoint& endpoint : Endpoints(config)) {
        const std::vector<std::string> numbers = NumericAddresses(endpoint.address);
        const bool served =
            std::any_of(listeners.begin(), listeners.end(), [&](const Listener& listener) {
                return listener.port == endpoint.port && IsOurFront(listener.pid) &&
                       IsAmong(numbers, listener.address);
            });
        if (!served) {
            return false;
        }
    }
    return true;
}

std::optional<Listener> OtherHolder(const ServerConfig& config,
                                    const std::vector<Listener>& listeners) {
    for (const Endpoint& endpoint : Endpoints(config)) {
        const std::vector<std::string> numbers = NumericAddresses(endpoint.address);
        for (const Listener& listener : listeners) {
            const bool same = listener.port == endpoint.port &&
                              (endpoint.address.empty() || listener.IsEverywhere() ||
                               IsAmong(numbers, listener.address));
            const bool seen = listener.pid != 0 || geteuid() == 0;
            if (same && seen && !IsOurFront(listener.pid)) {
                return listener;
            }
        }
    }
    return std::nullopt;
}

uid_t FrontUser() {
    return FrontIdentity().first;
}

gid_t FrontGroup() {
    return FrontIdentity().second;
}

}  // namespace zel_server
