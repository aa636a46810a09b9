// The doctor's check of the servers: do their names resolve, does anybody answer there.
#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>
#include <tuple>

#include "ZEL/zel.h"
#include "base/unique_fd.h"
#include "programs/zelctl/doctor/checks.h"

namespace zelctl {

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr milliseconds kPatience(3000);
constexpr size_t kAtOnce = 64;  // servers; each takes a descriptor for each of its addresses
constexpr uint32_t kSSHPort = 22;

struct AddressFree {
    void operator()(addrinfo* list) const { freeaddrinfo(list); }
};

/// A server of some tasks, on the port that they use.
struct Endpoint {
    std::string name;
    std::string address;
    std::string port;
    bool ssh = false;

    std::set<std::string> tasks;
    std::vector<base::UniqueFd> attempts;  // connections on their way
    bool reached = false;
    std::string fault;

    std::string Shown() const { return (name.empty() ? address : name) + ", port " + port; }
};

// Starts to connect to one address; true when that is done already.
bool StartConnecting(const std::string& address, Endpoint& endpoint) {
    addrinfo hints = {};
    hints.ai_flags = AI_NUMERICHOST | AI_NUMERICSERV;
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* list = nullptr;
    const int failed = getaddrinfo(address.c_str(), endpoint.port.c_str(), &hints, &list);
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
    endpoint.attempts.push_back(std::move(fd));
    return false;
}

void Start(Endpoint& endpoint) {
    std::vector<std::string> addresses;
    if (ZEL::GetUsableIP(endpoint.name, endpoint.address, addresses) != 0 || addresses.empty()) {
        endpoint.fault = "its name cannot be looked up";
        return;
    }
    for (const std::string& address : addresses) {
        endpoint.reached = endpoint.reached || StartConnecting(address, endpoint);
    }
}

// Looks how the attempts of `endpoint` have gone, which `events` tells in their order.
void Judge(Endpoint& endpoint, const pollfd* events) {
    std::vector<base::UniqueFd> left;
    for (size_t i = 0; i < endpoint.attempts.size(); ++i) {
        if (events[i].revents == 0) {
            left.push_back(std::move(endpoint.attempts[i]));
            continue;
        }
        int error = 0;
        socklen_t size = sizeof error;
        getsockopt(endpoint.attempts[i].Get(), SOL_SOCKET, SO_ERROR, &error, &size);
        endpoint.reached = endpoint.reached || error == 0;
        endpoint.fault = strerror(error);
    }
    endpoint.attempts = std::move(left);
    if (endpoint.reached) {
        endpoint.attempts.clear();
    }
}

// Waits until each of the endpoints is reached, has failed, or has had its time.
void Wait(Endpoint* begin, Endpoint* end) {
    const auto limit = steady_clock::now() + kPatience;
    for (;;) {
        std::vector<pollfd> events;
        for (const Endpoint* endpoint = begin; endpoint != end; ++endpoint) {
            for (const base::UniqueFd& fd : endpoint->attempts) {
                events.push_back({fd.Get(), POLLOUT, 0});
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
    const std::string daemon_port = std::to_string(RsyncSettings().daemon_port);
    std::map<std::tuple<std::string, std::string, std::string>, Endpoint> endpoints;
    for (const PatientTask& task : patient.tasks) {
        const ZEL::SyncInfo& info = task.record.GetInfo().GetSyncInfo();
        const uint32_t ssh_port = info.GetSSHPort() == 0 ? kSSHPort : info.GetSSHPort();
        const std::string port = info.UseSSH() ? std::to_string(ssh_port) : daemon_port;
        Endpoint& endpoint =
            endpoints[std::make_tuple(info.GetServerName(), info.GetServerIP(), port)];
        endpoint.name = info.GetServerName();
        endpoint.address = info.GetServerIP();
        endpoint.port = port;
        endpoint.ssh = info.UseSSH();
        endpoint.tasks.insert(task.record.GetInfo().GetName());
    }
    std::vector<Endpoint> list;
    list.reserve(endpoints.size());
    for (auto& [key, endpoint] : endpoints) {
        list.push_back(std::move(endpoint));
    }
    return list;
}

}  // namespace

std::set<std::string> CheckServers(const Patient& patient, Findings& findings) {
    std::set<std::string> cut_off;
    std::vector<Endpoint> endpoints = Gather(patient);
    for (size_t begin = 0; begin < endpoints.size(); begin += kAtOnce) {
        const size_t end = std::min(begin + kAtOnce, endpoints.size());
        for (size_t i = begin; i < end; ++i) {
            Start(endpoints[i]);
        }
        Wait(endpoints.data() + begin, endpoints.data() + end);
    }
    for (const Endpoint& endpoint : endpoints) {
        const std::string name = "server " + endpoint.Shown();
        const std::string users = " (" + TasksInWords(endpoint.tasks) + ")";
        if (endpoint.reached) {
            findings.push_back({name, Severity::kOk, "answers" + users, ""});
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
