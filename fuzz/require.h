#pragma once

#include <cstdlib>

/// What must hold of every input: the fuzzer keeps the one for which it does not.
inline void Require(bool holds) {
    if (!holds) {
        std::abort();
    }
}
