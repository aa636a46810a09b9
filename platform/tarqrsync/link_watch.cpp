#include "platform/tarqrsync/link_watch.h"

#include <arpa/inet.h>
#include <dirent.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <linux/sock_diag.h>
#include <linux/tcp.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <utility>

namespace TARQ {
namespace Backup {

namespace {

using base::UniqueFd;

// States of a connection that is up, or whose far end has closed its half.
constexpr uint32_t kEstablished = 1;
constexpr uint32_t kCloseWait = 8;
constexpr uint32_t kUpStates = (1U << kEstablished) | (1U << kCloseWait);

// More processes than ssh with its jumps has.
constexpr size_t kMaxProcesses = 32;

// A connection without traffic is probed, so that a peer that dies while nothing is on the way is
// found as well. The kernel gives up by itself somewhat later than the watch does.
constexpr int kProbeAfterSeconds = 10;
constexpr int kProbeEverySeconds = 10;
constexpr int kProbes = 15;

struct Request {
    nlmsghdr header;
    inet_diag_req_v2 query;
};

using OnConnection = std::function<void(const inet_diag_msg&, const tcp_info&)>;

// The netlink's messages lie in a buffer without a type of its own: they are copied out.
template <typename T>
bool ReadStruct(const char* bytes, size_t size, T* value) {
    *value = T();
    memcpy(value, bytes, std::min(size, sizeof(T)));
    return size >= sizeof(T);
}

size_t Aligned(size_t size) {
    return (size + 3) & ~size_t{3};
}

// Hands on the connection that one message is about.
void TakeMessage(const char* bytes, size_t size, const OnConnection& on_connection) {
    inet_diag_msg message;
    if (!ReadStruct(bytes, size, &message)) {
        return;
    }
    size_t at = Aligned(sizeof message);
    rtattr attribute;
    while (at < size && ReadStruct(bytes + at, size - at, &attribute) &&
           attribute.rta_len >= sizeof attribute && attribute.rta_len <= size - at) {
        if (attribute.rta_type == INET_DIAG_INFO) {
            tcp_info info;  // an older kernel has fewer fields
            ReadStruct(bytes + at + sizeof attribute, attribute.rta_len - sizeof attribute, &info);
            on_connection(message, info);
        }
        at += Aligned(attribute.rta_len);
    }
}

// Asks the kernel, and hands on each connection of its answer.
bool AskKernel(int kernel, const inet_diag_req_v2& query, bool all,
               const OnConnection& on_connection) {
    static std::atomic<uint32_t> number{0};
    Request request = {};
    request.header.nlmsg_len = sizeof request;
    request.header.nlmsg_type = SOCK_DIAG_BY_FAMILY;
    request.header.nlmsg_flags =
        static_cast<uint16_t>(NLM_F_REQUEST | (all ? static_cast<int>(NLM_F_DUMP) : 0));
    request.header.nlmsg_seq = ++number;
    request.query = query;
    if (send(kernel, &request, sizeof request, 0) != static_cast<ssize_t>(sizeof request)) {
        return false;
    }
    while (true) {
        std::array<char, 32768> buffer;
        const ssize_t count = recv(kernel, buffer.data(), buffer.size(), 0);
        if (count < 0 && errno == EINTR) {
            continue;
        }
        if (count <= 0) {
            return false;
        }
        const size_t size = static_cast<size_t>(count);
        nlmsghdr header;
        for (size_t at = 0; at < size && ReadStruct(buffer.data() + at, size - at, &header) &&
                            header.nlmsg_len >= sizeof header && header.nlmsg_len <= size - at;
             at += Aligned(header.nlmsg_len)) {
            if (header.nlmsg_seq != request.header.nlmsg_seq) {
                continue;  // left over from an abandoned request
            }
            if (header.nlmsg_type == NLMSG_DONE || header.nlmsg_type == NLMSG_ERROR) {
                return header.nlmsg_type == NLMSG_DONE;
            }
            TakeMessage(buffer.data() + at + sizeof header, header.nlmsg_len - sizeof header,
                        on_connection);
            if (!all) {
                return true;
            }
        }
    }
}

inet_diag_req_v2 Query(uint8_t family) {
    inet_diag_req_v2 query = {};
    query.sdiag_family = family;
    query.sdiag_protocol = IPPROTO_TCP;
    query.idiag_ext = 1U << (INET_DIAG_INFO - 1);
    query.idiag_states = kUpStates;
    return query;
}

// The program, its children, theirs, and so on.
std::vector<pid_t> Descendants(pid_t program) {
    std::vector<pid_t> processes = {program};
    for (size_t i = 0; i < processes.size() && processes.size() < kMaxProcesses; ++i) {
        const std::string pid = std::to_string(processes[i]);
        std::string path = "/proc/" + pid;
        path.append("/task/").append(pid).append("/children");
        std::ifstream children(path);
        for (pid_t child = 0; children >> child;) {
            processes.push_back(child);
        }
    }
    return processes;
}

struct Holder {
    pid_t process;
    int fd;
};

// The sockets that a process has open, by inode.
void AddSockets(pid_t process, std::map<uint32_t, Holder>* sockets) {
    const std::string folder = "/proc/" + std::to_string(process) + "/fd";
    const std::unique_ptr<DIR, int (*)(DIR*)> entries(opendir(folder.c_str()), closedir);
    while (const dirent* entry = entries ? readdir(entries.get()) : nullptr) {
        constexpr char kSocket[] = "socket:[";
        constexpr size_t kSocketLength = sizeof kSocket - 1;
        std::array<char, 64> target = {};
        const std::string path = folder + "/" + entry->d_name;
        if (readlink(path.c_str(), target.data(), target.size() - 1) > 0 &&
            strncmp(target.data(), kSocket, kSocketLength) == 0) {
            uint32_t inode = 0;
            std::from_chars(target.data() + kSocketLength, target.data() + target.size(), inode);
            sockets->emplace(inode, Holder{process, atoi(entry->d_name)});
        }
    }
}

// Makes the kernel probe a connection of another process. Where that is not allowed a silent
// connection is only known to be dead when something is sent.
void ProbeWhenIdle(const Holder& holder) {
#if defined(SYS_pidfd_open) && defined(SYS_pidfd_getfd)
    const UniqueFd process(static_cast<int>(syscall(SYS_pidfd_open, holder.process, 0)));
    const UniqueFd socket(
        process ? static_cast<int>(syscall(SYS_pidfd_getfd, process.Get(), holder.fd, 0)) : -1);
    if (!socket) {
        return;
    }
    const int on = 1;
    setsockopt(socket.Get(), IPPROTO_TCP, TCP_KEEPIDLE, &kProbeAfterSeconds, sizeof(int));
    setsockopt(socket.Get(), IPPROTO_TCP, TCP_KEEPINTVL, &kProbeEverySeconds, sizeof(int));
    setsockopt(socket.Get(), IPPROTO_TCP, TCP_KEEPCNT, &kProbes, sizeof(int));
    setsockopt(socket.Get(), SOL_SOCKET, SO_KEEPALIVE, &on, sizeof on);
#else
    static_cast<void>(holder);
#endif
}

bool AreEndsOfOne(const inet_diag_sockid& one, const inet_diag_sockid& other) {
    return one.idiag_sport == other.idiag_dport && one.idiag_dport == other.idiag_sport &&
           memcmp(one.idiag_src, other.idiag_dst, sizeof one.idiag_src) == 0 &&
           memcmp(one.idiag_dst, other.idiag_src, sizeof one.idiag_dst) == 0;
}

}  // namespace

LinkState LinkWatch::Look(pid_t program) {
    if (connections_.empty()) {
        Find(program);
    }
    LinkState state;
    state.connected = last_.connected;
    for (Connection& connection : connections_) {
        Ask(connection, state);
    }
    state.bytes_sent = std::max(state.bytes_sent, last_.bytes_sent);
    state.bytes_received = std::max(state.bytes_received, last_.bytes_received);
    last_ = state;
    return state;
}

void LinkWatch::Find(pid_t program) {
    if (!kernel_) {
        kernel_ = UniqueFd(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_SOCK_DIAG));
        const timeval patience = {1, 0};
        if (!kernel_ ||
            setsockopt(kernel_.Get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience) != 0) {
            kernel_.Reset();
            return;
        }
    }
    std::map<uint32_t, Holder> sockets;
    for (const pid_t process : Descendants(program)) {
        AddSockets(process, &sockets);
    }
    constexpr std::array<uint8_t, 2> kFamilies = {AF_INET, AF_INET6};
    for (const uint8_t family : kFamilies) {
        if (sockets.empty()) {
            return;
        }
        std::vector<std::pair<inet_diag_sockid, Holder>> found;
        AskKernel(kernel_.Get(), Query(family), true, [&](const inet_diag_msg& message, auto&) {
            const auto own = sockets.find(message.idiag_inode);
            if (own != sockets.end()) {
                found.emplace_back(message.id, own->second);
            }
        });
        for (const auto& [id, holder] : found) {
            // rsync speaks to the program that connects it over a pair of which both ends are here:
            // that is no way to a far end.
            const bool paired = std::any_of(
                found.begin(), found.end(),
                [&id = id](const auto& other) { return AreEndsOfOne(id, other.first); });
            if (!paired) {
                connections_.push_back({id, family, Clock::now()});
                ProbeWhenIdle(holder);
            }
        }
    }
}

void LinkWatch::Ask(Connection& connection, LinkState& state) {
    inet_diag_req_v2 query = Query(connection.family);
    query.id = connection.id;
    AskKernel(kernel_.Get(), query, false, [&](const inet_diag_msg&, const tcp_info& info) {
        const auto now = Clock::now();
        const bool waits = info.tcpi_unacked > 0 || info.tcpi_probes > 0;
        const auto heard = now - std::chrono::milliseconds(info.tcpi_last_ack_recv);
        connection.answered = waits ? std::max(connection.answered, heard) : now;
        state.connected = true;
        state.bytes_sent += info.tcpi_bytes_acked;
        state.bytes_received += info.tcpi_bytes_received;
        state.unanswered =
            std::max(state.unanswered,
                     std::chrono::duration_cast<std::chrono::seconds>(now - connection.answered));
    });
}

}  // namespace Backup
}  // namespace TARQ
