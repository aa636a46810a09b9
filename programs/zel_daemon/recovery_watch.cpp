#include "programs/zel_daemon/recovery_watch.h"

#include <fcntl.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "tarq/root_path.h"

namespace zel_daemon {

namespace {

base::UniqueFd OpenNetwork() {
    base::UniqueFd fd(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE));
    sockaddr_nl address = {};
    address.nl_family = AF_NETLINK;
    address.nl_groups = RTMGRP_LINK | RTMGRP_IPV4_IFADDR | RTMGRP_IPV4_ROUTE | RTMGRP_IPV6_IFADDR |
                        RTMGRP_IPV6_ROUTE;
    if (fd && bind(fd.Get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        fd.Reset();
    }
    return fd;
}

// What goes away brings nobody back.
bool Brings(const nlmsghdr& message) {
    if (message.nlmsg_type == RTM_NEWLINK) {
        ifinfomsg link = {};
        if (message.nlmsg_len < NLMSG_LENGTH(sizeof link)) {
            return false;
        }
        memcpy(&link, reinterpret_cast<const char*>(&message) + NLMSG_HDRLEN, sizeof link);
        return (link.ifi_flags & IFF_RUNNING) != 0;
    }
    return message.nlmsg_type == RTM_NEWADDR || message.nlmsg_type == RTM_NEWROUTE;
}

}  // namespace

RecoveryWatch::RecoveryWatch()
    : mounts_(open("/proc/self/mountinfo", O_RDONLY | O_CLOEXEC)),
      network_(OpenNetwork()),
      settings_(TARQ::RootPath("/usr/tarq/etc"),
                {"tarqshare.conf", "tarqrsync.conf", "tarqsdk.conf"}) {}

bool RecoveryWatch::NetworkChanged() {
    bool changed = false;
    alignas(nlmsghdr) char buffer[16384];
    for (;;) {
        const ssize_t size = recv(network_.Get(), buffer, sizeof buffer, 0);
        if (size < 0 && errno == EINTR) {
            continue;
        }
        if (size <= 0) {
            // More came than the socket holds: some of it may have mattered.
            return changed || (size < 0 && errno == ENOBUFS);
        }
        auto left = static_cast<unsigned int>(size);
        for (const char* at = buffer; left >= sizeof(nlmsghdr);) {
            nlmsghdr message;
            memcpy(&message, at, sizeof message);
            if (message.nlmsg_len < sizeof message || message.nlmsg_len > left) {
                break;
            }
            changed = changed || Brings(*reinterpret_cast<const nlmsghdr*>(at));
            const unsigned int step = std::min(NLMSG_ALIGN(message.nlmsg_len), left);
            at += step;
            left -= step;
        }
    }
}

}  // namespace zel_daemon
