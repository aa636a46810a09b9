// A hash of names that nobody outside can make collide.
#pragma once

#include <cstdint>
#include <string_view>

namespace zel_daemon {

/// SipHash-1-3 with a key of its own: names come from whoever may write to a share, and with a hash
/// that they could compute, a folder of well-chosen names would be searched in quadratic time.
class SipHash {
public:
    SipHash();
    uint64_t operator()(uint32_t number, std::string_view bytes) const;

private:
    uint64_t key_[2];
};

}  // namespace zel_daemon
