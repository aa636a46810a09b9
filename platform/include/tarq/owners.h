// C++ owners of the handles of tarq/core.h and tarq/share.h: each frees what it holds when it goes;
// and what hashes and lists hold as the C++ library has it. Header only.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "tarq/core.h"
#include "tarq/share.h"

namespace TARQ {

struct HandleFree {
    void operator()(KAPICSzHashRec* hash) const { KAPICSzHashFree(hash); }
    void operator()(KAPICSzListRec* list) const { KAPICSzListFree(list); }
    void operator()(TARQShareRec* share) const { TARQShareFree(share); }
    void operator()(char* text) const { KAPICStrPut(text); }
};

using HashOwner = std::unique_ptr<KAPICSzHashRec, HandleFree>;
using ListOwner = std::unique_ptr<KAPICSzListRec, HandleFree>;
using ShareOwner = std::unique_ptr<TARQShareRec, HandleFree>;
using TextOwner = std::unique_ptr<char, HandleFree>;  // of KAPICStrGet

/// Of no hash and no list: nothing.
inline std::map<std::string, std::string> Entries(const HashOwner& hash) {
    std::map<std::string, std::string> entries;
    const char* key = nullptr;
    const char* value = nullptr;
    for (int at = 0; hash && KAPICSzHashNext(hash.get(), &at, &key, &value) == 1;) {
        entries.emplace(key, value);
    }
    return entries;
}
inline std::vector<std::string> Entries(const ListOwner& list) {
    std::vector<std::string> entries;
    for (int i = 0; list && i < KAPICSzListCount(list.get()); ++i) {
        entries.emplace_back(KAPICSzListGet(list.get(), i));
    }
    return entries;
}

/// A hash of these entries; null when there is no memory for it.
inline HashOwner MakeHash(const std::map<std::string, std::string>& entries) {
    HashOwner hash(KAPICSzHashAlloc(static_cast<int>(entries.size())));
    for (const auto& [key, value] : entries) {
        if (!hash || KAPICSzHashSetValue(hash.get(), key.c_str(), value.c_str()) != 0) {
            return nullptr;
        }
    }
    return hash;
}

}  // namespace TARQ
