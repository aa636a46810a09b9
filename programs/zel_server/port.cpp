#include "programs/zel_server/port.h"

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>

#include "base/text.h"
#include "base/unique_fd.h"
#include "programs/common/text.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;

constexpr unsigned int kListening = 0x0a;  // TCP_LISTEN in the kernel's tables

struct AddressesFree {
    void operator()(addrinfo* list) const { freeaddrinfo(list); }
};
using Addresses = std::unique_ptr<addrinfo, AddressesFree>;

// The addresses that a daemon would bind to if it were configured with this one.
Addresses Resolve(const std::string& address, int port) {
    addrinfo hints = {};
    hints.ai_flags = AI_PASSIVE;
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* list = nullptr;
    const int failed = getaddrinfo(address.empty() ? nullptr : address.c_str(),
                                   std::to_string(port).c_str(), &hints, &list);
    return Addresses(failed == 0 ? list : nullptr);
}

std::string Numeric(int family, const void* address) {
    char text[INET6_ADDRSTRLEN];
    return inet_ntop(family, address, text, sizeof text) != nullptr ? text : "";
}

// Converts an address of the kernel's tables: 32-bit words in hexadecimal, in the byte order of the
// machine.
std::string NumericFromTable(const std::string& digits) {
    uint32_t words[4] = {};
    const size_t count = digits.size() / 8;
    for (size_t i = 0; i < std::min<size_t>(count, 4); ++i) {
        if (sscanf(digits.substr(i * 8, 8).c_str(), "%8" SCNx32, &words[i]) != 1) {
            return "";
        }
    }
    return Numeric(count == 1 ? AF_INET : AF_INET6, words);
}

struct Socket {
    unsigned long long inode;
    std::string address;
};

void ReadTable(const char* table, int port, std::vector<Socket>& sockets) {
    std::ifstream lines(table);
    for (std::string line; std::getline(lines, line);) {
        char address[33];
        unsigned int at_port = 0;
        unsigned int state = 0;
        unsigned long long inode = 0;
        if (sscanf(line.c_str(), " %*d: %32[0-9A-F]:%x %*[0-9A-F]:%*x %x %*s %*s %*s %*u %*u %llu",
                   address, &at_port, &state, &inode) == 4 &&
            at_port == static_cast<unsigned int>(port) && state == kListening) {
            sockets.push_back({inode, NumericFromTable(address)});
        }
    }
}

// Calls `take` for each process that has one of these sockets open, with its pid and the socket's
// inode.
template <typename Take>
void ForEachHolder(const Take& take) {
    std::error_code error;
    for (fs::directory_iterator process("/proc", error), end; !error && process != end;
         process.increment(error)) {
        const auto pid = base::ParseNumber(process->path().filename().native(), INT32_MAX);
        if (!pid) {
            continue;
        }
        std::error_code gone;
        for (fs::directory_iterator fd(process->path() / "fd", gone), last; !gone && fd != last;
             fd.increment(gone)) {
            std::error_code closed;
            unsigned long long inode = 0;
            if (sscanf(fs::read_symlink(*fd, closed).c_str(), "socket:[%llu]", &inode) == 1) {
                take(static_cast<pid_t>(*pid), inode);
            }
        }
    }
}

std::string ProgramOf(pid_t pid) {
    std::string name;
    std::ifstream comm("/proc/" + std::to_string(pid) + "/comm");
    std::getline(comm, name);
    return name;
}

}  // namespace

std::vector<Listener> ListenersOn(int port) {
    std::vector<Socket> sockets;
    ReadTable("/proc/net/tcp", port, sockets);
    ReadTable("/proc/net/tcp6", port, sockets);
    std::map<unsigned long long, pid_t> holders;  // the oldest where several share one
    for (const Socket& socket : sockets) {
        holders[socket.inode] = 0;
    }
    if (!holders.empty()) {
        ForEachHolder([&](pid_t pid, unsigned long long inode) {
            const auto found = holders.find(inode);
            if (found != holders.end() && (found->second == 0 || pid < found->second)) {
                found->second = pid;
            }
        });
    }
    std::vector<Listener> listeners;
    for (const Socket& socket : sockets) {
        const pid_t pid = holders[socket.inode];
        listeners.push_back({socket.address, port, pid, pid == 0 ? "" : ProgramOf(pid)});
    }
    return listeners;
}

std::vector<std::string> NumericAddresses(const std::string& address) {
    std::vector<std::string> numbers;
    const Addresses list = Resolve(address, 0);
    for (const addrinfo* entry = list.get(); entry != nullptr; entry = entry->ai_next) {
        const void* const bytes =
            entry->ai_family == AF_INET
                ? static_cast<const void*>(
                      &reinterpret_cast<const sockaddr_in*>(entry->ai_addr)->sin_addr)
                : &reinterpret_cast<const sockaddr_in6*>(entry->ai_addr)->sin6_addr;
        numbers.push_back(Numeric(entry->ai_family, bytes));
    }
    return numbers;
}

int TryToListen(const std::string& address, int port) {
    const Addresses list = Resolve(address, port);
    if (!list) {
        return EADDRNOTAVAIL;
    }
    for (const addrinfo* entry = list.get(); entry != nullptr; entry = entry->ai_next) {
        const base::UniqueFd fd(
            socket(entry->ai_family, entry->ai_socktype | SOCK_CLOEXEC, entry->ai_protocol));
        if (!fd) {
            continue;  // IPv4 or IPv6 is not available
        }
        const int on = 1;
        setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
        if (entry->ai_family == AF_INET6) {
            setsockopt(fd.Get(), IPPROTO_IPV6, IPV6_V6ONLY, &on, sizeof on);
        }
        if (bind(fd.Get(), entry->ai_addr, entry->ai_addrlen) != 0 || listen(fd.Get(), 1) != 0) {
            return errno;
        }
    }
    return 0;
}

}  // namespace zel_server
