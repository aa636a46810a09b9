#include <map>
#include <string>
#include <string_view>

#include "platform/internal/error.h"

using tarq_internal::Fail;
using tarq_internal::Guarded;

// A sorted tree: values keep their place while others come and go, and the walk's order is the
// keys' own.
struct KAPICSzHashRec {
    std::map<std::string, std::string, std::less<>> entries;

    // Where the last step of a walk ended, so that a walk by position costs a step each, not a
    // search from the start.
    int walk_position = 0;
    std::map<std::string, std::string, std::less<>>::const_iterator walk_at;
};

KAPICSzHash KAPICSzHashAlloc(int) {
    return Guarded<KAPICSzHash>(nullptr, [] { return new KAPICSzHashRec; });
}

void KAPICSzHashFree(KAPICSzHash hash) {
    delete hash;
}

const char* KAPICSzHashGetValue(KAPICSzHash hash, const char* key) {
    if (hash == nullptr || key == nullptr) {
        return nullptr;
    }
    const auto found = hash->entries.find(std::string_view(key));
    return found == hash->entries.end() ? nullptr : found->second.c_str();
}

int KAPICSzHashSetValue(KAPICSzHash hash, const char* key, const char* value) {
    if (hash == nullptr || key == nullptr || value == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    return Guarded(-1, [&] {
        std::string copy =
            value;  // made first: `value` may be the hash's own, and a failure must change nothing
        hash->entries.insert_or_assign(key, std::move(copy));
        hash->walk_position = 0;
        return 0;
    });
}

void KAPICHashRemoveAll(KAPICSzHash hash) {
    if (hash != nullptr) {
        hash->entries.clear();
        hash->walk_position = 0;
    }
}

int KAPICSzHashNext(KAPICSzHash hash, int* position, const char** key, const char** value) {
    if (hash == nullptr || position == nullptr || key == nullptr || value == nullptr ||
        *position < 0 || static_cast<size_t>(*position) >= hash->entries.size()) {
        return 0;
    }
    if (*position == 0 || *position != hash->walk_position) {
        hash->walk_at = std::next(hash->entries.cbegin(), *position);
    }
    *key = hash->walk_at->first.c_str();
    *value = hash->walk_at->second.c_str();
    ++hash->walk_at;
    hash->walk_position = ++*position;
    return 1;
}
