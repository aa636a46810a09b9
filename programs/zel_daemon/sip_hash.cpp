#include "programs/zel_daemon/sip_hash.h"

#include <cstring>
#include <random>

namespace zel_daemon {

namespace {

uint64_t Rotate(uint64_t value, int bits) {
    return value << bits | value >> (64 - bits);
}

struct State {
    uint64_t v0, v1, v2, v3;

    void Round() {
        v0 += v1;
        v2 += v3;
        v1 = Rotate(v1, 13) ^ v0;
        v3 = Rotate(v3, 16) ^ v2;
        v0 = Rotate(v0, 32) + v3;
        v2 += v1;
        v1 = Rotate(v1, 17) ^ v2;
        v3 = Rotate(v3, 21) ^ v0;
        v2 = Rotate(v2, 32);
    }
    void Take(uint64_t word) {
        v3 ^= word;
        Round();
        v0 ^= word;
    }
};

}  // namespace

SipHash::SipHash() {
    std::random_device random;
    for (uint64_t& word : key_) {
        word = uint64_t{random()} << 32 | random();
    }
}

uint64_t SipHash::operator()(uint32_t number, std::string_view bytes) const {
    State state = {key_[0] ^ 0x736f6d6570736575, key_[1] ^ 0x646f72616e646f6d,
                   key_[0] ^ 0x6c7967656e657261, key_[1] ^ 0x7465646279746573};
    state.Take(uint64_t{bytes.size()} << 32 | number);
    for (; bytes.size() >= 8; bytes.remove_prefix(8)) {
        uint64_t word;
        std::memcpy(&word, bytes.data(), 8);
        state.Take(word);
    }
    uint64_t rest = 0;
    std::memcpy(&rest, bytes.data(), bytes.size());
    state.Take(rest);
    state.v2 ^= 0xff;
    for (int i = 0; i < 3; ++i) {
        state.Round();
    }
    return state.v0 ^ state.v1 ^ state.v2 ^ state.v3;
}

}  // namespace zel_daemon
