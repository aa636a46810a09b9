#include "ZEL/internal/cert_name.h"

#include <algorithm>
#include <array>
#include <string_view>

namespace ZEL {

namespace {

// A table rather than tolower(): a host's locale must not decide which certificate is accepted.
constexpr std::array<unsigned char, 256> MakeFolding() {
    std::array<unsigned char, 256> folding = {};
    for (size_t i = 0; i < folding.size(); ++i) {
        const bool upper = i >= 'A' && i <= 'Z';
        folding[i] = static_cast<unsigned char>(upper ? i - 'A' + 'a' : i);
    }
    return folding;
}

constexpr std::array<unsigned char, 256> kFolding = MakeFolding();

bool SameFolded(std::string_view a, std::string_view b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(), [](char x, char y) {
        return kFolding[static_cast<unsigned char>(x)] == kFolding[static_cast<unsigned char>(y)];
    });
}

}  // namespace

bool CertNameCovers(const std::string& name, const std::string& host) {
    // A zero byte inside either would make a C string of it that ends early:
    // good.example\0.evil.example.
    if (name.find('\0') != std::string::npos || host.find('\0') != std::string::npos) {
        return false;
    }
    if (name.empty() || name[0] != '*') {
        return SameFolded(name, host);
    }
    if (name.size() < 2) {
        return false;
    }
    const std::string_view parent = std::string_view(name).substr(2);
    if (SameFolded(parent, host)) {
        return true;
    }
    const size_t dot = host.find('.');
    return dot != std::string::npos && SameFolded(parent, std::string_view(host).substr(dot + 1));
}

}  // namespace ZEL
