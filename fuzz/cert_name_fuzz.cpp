// A certificate's name and a host name, a line each: what one covers of the other.
#include <algorithm>
#include <cstdint>
#include <string>

#include "ZEL/internal/cert_name.h"
#include "fuzz/require.h"

namespace {

std::string Upper(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](char c) { return c >= 'a' && c <= 'z' ? static_cast<char>(c - 32) : c; });
    return text;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string input(reinterpret_cast<const char*>(data), size);
    const size_t end = std::min(input.find('\n'), input.size());
    const std::string name = input.substr(0, end);
    const std::string host = end < size ? input.substr(end + 1) : "";
    const bool covers = ZEL::CertNameCovers(name, host);
    Require(covers == ZEL::CertNameCovers(Upper(name), host));
    if (!covers) {
        return 0;
    }
    Require(input.find('\0') == std::string::npos);
    if (name.compare(0, 1, "*") != 0) {
        Require(Upper(name) == Upper(host));
        return 0;
    }
    // The host is the wildcard's parent, with at most one label in front of it.
    const std::string parent = Upper(name.substr(2));
    Require(parent.size() <= host.size());
    const size_t at = host.size() - parent.size();
    Require(Upper(host.substr(at)) == parent);
    Require(at == 0 || host.find('.') == at - 1);
    return 0;
}
