// What every operation does at the border to its C callers.
#pragma once

#include <tarq/core.h>

#include <cerrno>
#include <exception>
#include <utility>

namespace tarq_internal {

/// Sets the thread's error code, with the caller's position and errno kept. Always -1, the result
/// of most operations that fail.
inline int Fail(int code, int line = __builtin_LINE(), const char* file = __builtin_FILE()) {
    const int saved = errno;
    KAPICErrSetEx(code, file, line);
    errno = saved;  // a test or another host may have put its own KAPICErrSetEx in front
    return -1;
}

/// Runs `body` for a C caller, whom no exception may reach: all that is thrown below comes from
/// running out of memory, and becomes TARQ_ERR_NO_MEMORY and the result `failed`.
template <typename Result, typename Body>
Result Guarded(Result failed, Body&& body, int line = __builtin_LINE(),
               const char* file = __builtin_FILE()) noexcept {
    try {
        return std::forward<Body>(body)();
    } catch (const std::exception&) {
        Fail(TARQ_ERR_NO_MEMORY, line, file);
        return failed;
    }
}

}  // namespace tarq_internal
