// The doctor's check of the servers: does the name resolve, does the server answer, and does it
// have the trusted key.
#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <future>
#include <memory>
#include <optional>
#include <tuple>

#include "ZEL/zel.h"
#include "base/unique_fd.h"
#include "programs/common/task_fields.h"
#include "programs/common/transport_words.h"
#include "programs/zelctl/doctor/checks.h"
#include "tarq/rsync_servers.h"

namespace zelctl {

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;
using TARQ::Backup::RsyncServer;
using TARQ::Backup::ServersError;
using TARQ::Backup::ServerTransport;

constexpr milliseconds kPatience(3000);
constexpr int kKeyPatience = 5;     // seconds
constexpr size_t kKeysAtOnce = 16;  // servers whose keys are checked at the same time
constexpr size_t kAtOnce = 64;      // servers; each uses a descriptor for each of its addresses

struct AddressFree {
    void operator()(addrinfo* list) const { freeaddrinfo(list); }
};

/// A connection attempt in progress.
struct Attempt {
    base::UniqueFd fd;
    std::string address;
};

/// A server of one or more tasks, with the port that they use.
struct Endpoint {
    std::string name;
    std::string address;
    int port = 0;
    bool ssh = false;
    std::optional<RsyncServer> known;  // if it is trusted

    std::set<std::string> tasks;
    std::vector<Attempt> attempts;
    bool reached = false;
    std::string reached_at;  // the address that answered
    std::string fault;
    std::string other_key;  // its actual key if that differs from the trusted one, or why it cannot
                            // be fetched

    const std::string& Server() const { return name.empty() ? address : name; }
};

// Starts to connect to one address; true when the connection is established at once.
bool StartConnecting(const std::string& address, Endpoint& endpoint) {
    addrinfo hints = {};
    hints.ai_flags = AI_NUMERICHOST | AI_NUMERICSERV;
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* list = nullptr;
    const int failed =
        getaddrinfo(address.c_str(), std::to_string(endpoint.port).c_str(), &hints, &list);
    const std::unique_ptr<addrinfo, AddressFree> owner(list);
    if (failed != 0) {
        endpoint.fault = address + " is no address";
        return false;
    }
    base::UniqueFd fd(socket(list->ai_family, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (fd && connect(fd.Get(), list->ai_addr, list->ai_addrlen) == 0) {
        return true;
    }
    if (!fd || errno != EINPROGRESS) {
        endpoint.fault = strerror(errno);
        return false;
    }
    endpoint.attempts.push_back({std::move(fd), address});
    return false;
}

void Start(Endpoint& endpoint) {
    std::vector<std::string> addresses;
    if (ZEL::GetUsableIP(endpoint.name, endpoint.address, addresses) != 0 || addresses.empty()) {
        endpoint.fault = "its name cannot be looked up";
        return;
    }
    for (const std::string& address : addresses) {
        if (!endpoint.reached && StartConnecting(address, endpoint)) {
            endpoint.reached = true;
            endpoint.reached_at = address;
        }
    }
}

// Evaluates the connection attempts of `endpoint`; `events` has the poll results in their order.
void Judge(Endpoint& endpoint, const pollfd* events) {
    std::vector<Attempt> left;
    for (size_t i = 0; i < endpoint.attempts.size(); ++i) {
        if (events[i].revents == 0) {
            left.push_back(std::move(endpoint.attempts[i]));
            continue;
        }
        int error = 0;
        socklen_t size = sizeof error;
        getsockopt(endpoint.attempts[i].fd.Get(), SOL_SOCKET, SO_ERROR, &error, &size);
        if (!endpoint.reached && error == 0) {
            endpoint.reached = true;
            endpoint.reached_at = endpoint.attempts[i].address;
        }
        endpoint.fault = strerror(error);
    }
    endpoint.attempts = std::move(left);
    if (endpoint.reached) {
        endpoint.attempts.clear();
    }
}

// Waits until each endpoint is reached or has failed, or until the time-out.
void Wait(Endpoint* begin, Endpoint* end) {
    const auto limit = steady_clock::now() + kPatience;
    for (;;) {
        std::vector<pollfd> events;
        for (const Endpoint* endpoint = begin; endpoint != end; ++endpoint) {
            for (const Attempt& attempt : endpoint->attempts) {
                events.push_back({attempt.fd.Get(), POLLOUT, 0});
            }
        }
        const auto left =
            std::chrono::duration_cast<milliseconds>(limit - steady_clock::now()).count();
        if (events.empty() || left <= 0 ||
            poll(events.data(), events.size(), static_cast<int>(left)) < 0) {
            break;
        }
        const pollfd* next = events.data();
        for (Endpoint* endpoint = begin; endpoint != end; ++endpoint) {
            const size_t count = endpoint->attempts.size();
            Judge(*endpoint, next);
            next += count;
        }
    }
    for (Endpoint* endpoint = begin; endpoint != end; ++endpoint) {
        if (!endpoint->attempts.empty()) {
            endpoint->fault = "no answer within 3 seconds";
            endpoint->attempts.clear();
        }
    }
}

std::vector<Endpoint> Gather(const Patient& patient) {
    const int daemon_port = RsyncSettings().daemon_port;
    const int ssh_port = TARQ::Backup::DefaultServerPort(ServerTransport::SSH);
    std::map<std::tuple<std::string, std::string, int>, Endpoint> endpoints;
    for (const PatientTask& task : patient.tasks) {
        const ZEL::SyncInfo& info = task.record.GetInfo().GetSyncInfo();
        const std::optional<RsyncServer> known = TARQ::Backup::FindServer(programs::ServerOf(info));
        bool ssh = info.UseSSH();
        int port = ssh ? static_cast<int>(info.GetSSHPort()) : daemon_port;
        if (known) {
            ssh = known->transport == ServerTransport::SSH;
            port =
                known->port == 0 ? TARQ::Backup::DefaultServerPort(known->transport) : known->port;
        }
        port = port == 0 ? ssh_port : port;
        Endpoint& endpoint =
            endpoints[std::make_tuple(info.GetServerName(), info.GetServerIP(), port)];
        endpoint.name = info.GetServerName();
        endpoint.address = info.GetServerIP();
        endpoint.port = port;
        endpoint.ssh = ssh;
        endpoint.known = known;
        endpoint.tasks.insert(task.record.GetInfo().GetName());
    }
    std::vector<Endpoint> list;
    list.reserve(endpoints.size());
    for (auto& [key, endpoint] : endpoints) {
        list.push_back(std::move(endpoint));
    }
    return list;
}

// Checks whether the server has the trusted key.
void CompareKey(Endpoint& endpoint) {
    const RsyncServer& known = *endpoint.known;
    try {
        const std::string shown =
            endpoint.ssh
                ? TARQ::Backup::FetchHostKey(endpoint.reached_at, endpoint.port, known.fingerprint,
                                             kKeyPatience)
                      .fingerprint
                : TARQ::Backup::FetchFingerprint(endpoint.reached_at, endpoint.port, kKeyPatience);
        if (shown != known.fingerprint) {
            endpoint.other_key =
                "shows the key " + shown + ", and " + known.fingerprint + " is trusted";
        }
    } catch (const ServersError& error) {
        endpoint.other_key = error.what();
    }
}

void CompareKeys(std::vector<Endpoint>& endpoints) {
    std::vector<std::future<void>> questions;
    for (Endpoint& endpoint : endpoints) {
        if (!endpoint.reached || !endpoint.known ||
            endpoint.known->transport == ServerTransport::PLAIN) {
            continue;
        }
        if (questions.size() == kKeysAtOnce) {
            questions.clear();  // waits for them to finish
        }
        questions.push_back(std::async(std::launch::async, [&endpoint] { CompareKey(endpoint); }));
    }
}

// The finding about the trust in a server that answers.
Finding TrustFinding(const Endpoint& endpoint, const std::string& name, const std::string& users) {
    const std::string trust = "zelctl trust " + endpoint.Server();
    if (!endpoint.other_key.empty()) {
        return {name, Severity::kFailed, endpoint.other_key + users,
                "somebody may be in between; if the server was set up anew: " + trust +
                    (endpoint.ssh ? " --ssh" : "")};
    }
    const std::string way =
        "answers: " + programs::TransportWords(endpoint.Server(), endpoint.ssh, 0) + users;
    if (endpoint.known && endpoint.known->transport != ServerTransport::PLAIN) {
        return {name, Severity::kOk, way, ""};
    }
    if (endpoint.ssh) {
        return {name, Severity::kWarning, way, trust + " --ssh"};
    }
    const bool alone = TARQ::Backup::IsLoopbackHost(endpoint.Server());
    return {name, alone ? Severity::kOk : Severity::kWarning, way, alone ? "" : trust};
}

}  // namespace

std::set<std::string> CheckServers(const Patient& patient, Findings& findings) {
    std::set<std::string> cut_off;
    std::vector<Endpoint> endpoints;
    try {
        endpoints = Gather(patient);
    } catch (const ServersError& error) {
        findings.push_back({"trusted servers", Severity::kFailed, error.what(),
                            "nothing is pushed until the file is right again"});
        for (const PatientTask& task : patient.tasks) {
            cut_off.insert(task.record.GetInfo().GetName());
        }
        return cut_off;
    }
    for (size_t begin = 0; begin < endpoints.size(); begin += kAtOnce) {
        const size_t end = std::min(begin + kAtOnce, endpoints.size());
        for (size_t i = begin; i < end; ++i) {
            Start(endpoints[i]);
        }
        Wait(endpoints.data() + begin, endpoints.data() + end);
    }
    CompareKeys(endpoints);
    for (const Endpoint& endpoint : endpoints) {
        const std::string name =
            "server " + endpoint.Server() + ", port " + std::to_string(endpoint.port);
        const std::string users = " (" + TasksInWords(endpoint.tasks) + ")";
        if (endpoint.reached) {
            findings.push_back(TrustFinding(endpoint, name, users));
        } else {
            cut_off.insert(endpoint.tasks.begin(), endpoint.tasks.end());
            findings.push_back(
                {name, Severity::kFailed, endpoint.fault + users,
                 std::string("check the name, the network and the firewall; at the server: ") +
                     (endpoint.ssh ? "is sshd running?" : "zel_server status")});
        }
    }
    return cut_off;
}

}  // namespace zelctl
