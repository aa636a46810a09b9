#include "platform/tarqnetsdk/interfaces.h"

#include <net/if.h>
#include <stdio.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <regex>
#include <tuple>

#include "base/text.h"
#include "base/whole_file.h"

namespace tarq_net {
namespace {

namespace fs = std::filesystem;

constexpr long kEthernet = 1;  // ARPHRD_ETHER: wired and wireless alike
constexpr unsigned char kLocalBit =
    0x2;  // of a hardware address: given by software, not by a maker
constexpr unsigned char kGroupBit = 0x1;

enum Kind { kAdapter, kVirtual, kPlumbing };

/// An interface with all that its rank depends on.
struct Candidate {
    Interface interface;
    Kind kind;
    bool random;           // a new address at each start
    bool local;            // locally administered
    bool usb;              // can be plugged elsewhere
    std::string position;  // the device's path in sysfs; empty for what has no device
};

std::string Attribute(const fs::path& folder, const char* name) {
    return std::string(base::Trimmed(base::ReadFile(folder / name).value_or("")));
}

long Number(const std::string& text) {
    return strtol(text.c_str(), nullptr, 0);
}

bool Exists(const fs::path& path) {
    std::error_code ignored;
    return fs::exists(path, ignored);
}

bool ParseMac(const std::string& text, std::array<unsigned char, 6>* mac) {
    int end = 0;
    auto& m = *mac;
    return sscanf(text.c_str(), "%2hhx:%2hhx:%2hhx:%2hhx:%2hhx:%2hhx%n", &m[0], &m[1], &m[2], &m[3],
                  &m[4], &m[5], &end) == 6 &&
           static_cast<size_t>(end) == text.size();
}

bool IsUsable(const std::array<unsigned char, 6>& mac) {
    return (mac[0] & kGroupBit) == 0 &&
           std::any_of(mac.begin(), mac.end(), [](unsigned char byte) { return byte != 0; });
}

Kind KindOf(const fs::path& folder, const std::string& name, bool has_device) {
    if (has_device) {
        return kAdapter;
    }
    // Comes and goes with containers, virtual machines and tunnels. A pair's end that is a
    // container's own "eth0" is all the container has, and keeps its place by its name.
    static const std::regex plumbing(
        "(docker|br-|veth|virbr|vnet|tap|tun|wg|lxc|lxd|cni|ifb|dummy).*");
    return Exists(folder / "bridge") || Exists(folder / "tun_flags") ||
                   std::regex_match(name, plumbing)
               ? kPlumbing
               : kVirtual;
}

std::optional<Candidate> Examine(const fs::path& folder, const std::string& name) {
    const long flags = Number(Attribute(folder, "flags"));
    if (Number(Attribute(folder, "type")) != kEthernet || (flags & IFF_LOOPBACK) != 0 ||
        name.size() >= IFNAMSIZ) {
        return std::nullopt;
    }
    Candidate candidate{};
    candidate.interface.name = name;
    candidate.interface.up = (flags & IFF_UP) != 0;

    // A bond gives all its adapters one address; what each had before is kept for it here.
    std::string address = Attribute(folder, "bonding_slave/perm_hwaddr");
    const bool permanent = !address.empty();
    if (!permanent) {
        address = Attribute(folder, "address");
    }
    if (!ParseMac(address, &candidate.interface.mac) || !IsUsable(candidate.interface.mac)) {
        return std::nullopt;
    }

    std::error_code error;
    const fs::path device = fs::canonical(folder / "device", error);
    candidate.kind = KindOf(folder, name, !error);
    candidate.position = error ? "" : device.string();
    candidate.usb = std::regex_search(candidate.position, std::regex("/usb[0-9]+/"));
    candidate.random = !permanent && Number(Attribute(folder, "addr_assign_type")) == 1;
    candidate.local = (candidate.interface.mac[0] & kLocalBit) != 0;
    return candidate;
}

/// Digits that stand together count as one number: "eth2" comes before "eth10".
bool NaturalLess(const std::string& a, const std::string& b) {
    return strverscmp(a.c_str(), b.c_str()) < 0;
}

bool ComesBefore(const Candidate& a, const Candidate& b) {
    const auto rank = [](const Candidate& c) { return std::tie(c.kind, c.random, c.local, c.usb); };
    if (rank(a) != rank(b)) {
        return rank(a) < rank(b);
    }
    if (a.position != b.position) {
        return NaturalLess(a.position, b.position);
    }
    return NaturalLess(a.interface.name, b.interface.name);
}

}  // namespace

std::optional<std::vector<Interface>> ListInterfaces(const std::string& sys) {
    std::error_code error;
    std::vector<Candidate> candidates;
    fs::directory_iterator entry(sys + "/class/net", error);
    for (; !error && entry != fs::directory_iterator(); entry.increment(error)) {
        if (auto candidate = Examine(entry->path(), entry->path().filename())) {
            candidates.push_back(std::move(*candidate));
        }
    }
    if (error) {
        errno = error.value();
        return std::nullopt;
    }
    std::sort(candidates.begin(), candidates.end(), ComesBefore);
    std::vector<Interface> interfaces;
    interfaces.reserve(candidates.size());
    for (Candidate& candidate : candidates) {
        interfaces.push_back(std::move(candidate.interface));
    }
    return interfaces;
}

}  // namespace tarq_net
