#pragma once

#include <initializer_list>
#include <string>
#include <utility>
#include <vector>

#include "tarq/core.h"

namespace test {

/// A string hash with some values, freed at the end.
struct Hash {
    KAPICSzHash hash = KAPICSzHashAlloc(16);

    Hash(std::initializer_list<std::pair<std::string, std::string>> values = {}) {
        for (const auto& [key, value] : values) {
            KAPICSzHashSetValue(hash, key.c_str(), value.c_str());
        }
    }
    Hash(const Hash&) = delete;
    Hash& operator=(const Hash&) = delete;
    ~Hash() { KAPICSzHashFree(hash); }
    operator KAPICSzHash() const { return hash; }

    /// All keys and values, in the order of the walk.
    std::vector<std::pair<std::string, std::string>> All() const {
        std::vector<std::pair<std::string, std::string>> all;
        const char *key = nullptr, *value = nullptr;
        for (int at = 0; KAPICSzHashNext(hash, &at, &key, &value) != 0;) {
            all.emplace_back(key, value);
        }
        return all;
    }
};

}  // namespace test
