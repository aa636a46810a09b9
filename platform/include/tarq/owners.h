// C++ owners of the handles of tarq/core.h and tarq/share.h: each frees what it holds when it goes.
// Header only.
#pragma once

#include <memory>

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

}  // namespace TARQ
