#include <climits>
#include <deque>
#include <string>

#include "platform/tarqcore/error.h"

using tarqcore::Fail;
using tarqcore::Guarded;

// A deque: its strings stay where they are while others are pushed.
struct KAPICSzListRec {
    std::deque<std::string> items;
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
        list->items.emplace_back(item);
        return 0;
    });
}

void KAPICSzListRemoveAll(KAPICSzList list) {
    if (list != nullptr) {
        list->items.clear();
    }
}

int KAPICSzListCount(KAPICSzList list) {
    return list == nullptr ? 0 : static_cast<int>(list->items.size());
}

const char* KAPICSzListGet(KAPICSzList list, int index) {
    if (index < 0 || index >= KAPICSzListCount(list)) {
        return nullptr;
    }
    return list->items[static_cast<size_t>(index)].c_str();
}
