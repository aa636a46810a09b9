#pragma once

#include <new>
#include <stdexcept>
#include <utility>

#include "tarq/core.h"

namespace tarqcore {

/// Sets the thread's error code, with the caller's position and errno kept. Always -1, the result
/// of most operations that fail.
int Fail(TARQErrorCode code, int line = __builtin_LINE(), const char* file = __builtin_FILE());

/// Runs `body` at the C border: running out of memory becomes TARQ_ERR_NO_MEMORY and the result
/// `failed`.
template <typename Result, typename Body>
Result Guarded(Result failed, Body&& body, int line = __builtin_LINE(),
               const char* file = __builtin_FILE()) noexcept {
    try {
        return std::forward<Body>(body)();
    } catch (const std::bad_alloc&) {
        Fail(TARQ_ERR_NO_MEMORY, line, file);
    } catch (const std::length_error&) {
        Fail(TARQ_ERR_NO_MEMORY, line, file);
    }
    return failed;
}

}  // namespace tarqcore
