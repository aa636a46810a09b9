#include "ZEL/internal/cert_name.h"

#include <algorithm>
#include <string_view>

#include "base/text.h"

namespace ZEL {

namespace {

bool SameFolded(std::string_view a, std::string_view b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(),
                      [](char x, char y) { return base::Lower(x) == base::Lower(y); });
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
