// The machine's network interfaces in the order in which they identify it.
#pragma once

#include <array>
#include <optional>
#include <string>
#include <vector>

namespace tarq_net {

struct Interface {
    std::string name;
    std::array<unsigned char, 6> mac;
    bool up;  ///< administratively
};

/// Reads `sys`/class/net (`sys` is normally "/sys"). Nothing, with errno set, when it cannot be
/// listed.
std::optional<std::vector<Interface>> ListInterfaces(const std::string& sys);

}  // namespace tarq_net
