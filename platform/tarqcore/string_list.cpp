#include <string.h>

#include <algorithm>
#include <climits>
#include <memory>
#include <vector>

#include "platform/internal/error.h"

using tarq_internal::Fail;
using tarq_internal::Guarded;

// The strings lie one behind the other in chunks, so that they stay in place while others are
// pushed and a list of ten thousand section names costs a few allocations.
struct KAPICSzListRec {
    std::vector<const char*> items;
    std::vector<std::unique_ptr<char[]>> chunks;
    size_t free_bytes = 0;  // at the end of the last chunk
    char* free_at = nullptr;
    size_t next_chunk = 256;  // grows with the list, up to kMaxChunk

    static constexpr size_t kMaxChunk = 64 << 10;

    void Push(const char* item) {
        const size_t size = strlen(item) + 1;
        if (size > free_bytes) {
            const size_t chunk = std::max(size, next_chunk);
            chunks.emplace_back(new char[chunk]);
            free_at = chunks.back().get();
            free_bytes = chunk;
            next_chunk = std::min(2 * next_chunk, kMaxChunk);
        }
        items.push_back(free_at);
        memcpy(free_at, item, size);
        free_at += size;
        free_bytes -= size;
    }
};

KAPICSzList KAPICSzListAlloc(int) {
    return Guarded<KAPICSzList>(nullptr, [] { return new KAPICSzListRec; });
}

void KAPICSzListFree(KAPICSzList list) {
    delete list;
}

int KAPICSzListPush(KAPICSzList list, const char* item) {
    if (list == nullptr || item == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    if (list->items.size() >= static_cast<size_t>(INT_MAX)) {
        return Fail(TARQ_ERR_NO_MEMORY);
    }
    return Guarded(-1, [&] {
        list->Push(item);
        return 0;
    });
}

void KAPICSzListRemoveAll(KAPICSzList list) {
    if (list != nullptr) {
        *list = {};
    }
}

int KAPICSzListCount(KAPICSzList list) {
    return list == nullptr ? 0 : static_cast<int>(list->items.size());
}

const char* KAPICSzListGet(KAPICSzList list, int index) {
    if (index < 0 || index >= KAPICSzListCount(list)) {
        return nullptr;
    }
    return list->items[static_cast<size_t>(index)];
}
