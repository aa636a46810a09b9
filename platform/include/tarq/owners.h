// C++ owners of the handles of tarq/core.h: each frees what it holds when it goes. Header only.
#pragma once

#include <memory>

#include "tarq/core.h"

namespace TARQ {

struct HandleFree {
    void operator()(KAPICSzHashRec* hash) const { KAPICSzHashFree(hash); }
    void operator()(KAPICSzListRec* list) const { KAPICSzListFree(list); }
    void operator()(char* text) const { KAPICStrPut(text); }
};

using HashOwner = std::unique_ptr<KAPICSzHashRec, HandleFree>;
using ListOwner = std::unique_ptr<KAPICSzListRec, HandleFree>;
using TextOwner = std::unique_ptr<char, HandleFree>;  // of KAPICStrGet

}  // namespace TARQ
