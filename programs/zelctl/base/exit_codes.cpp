#include "programs/zelctl/base/exit_codes.h"

#include <cstdarg>
#include <cstdio>

namespace zelctl {

ExitCode CodeOf(programs::Trouble trouble) {
    switch (trouble) {
        case programs::Trouble::kNone:
            return kOk;
        case programs::Trouble::kLocal:
            return kLocal;
        case programs::Trouble::kRefused:
            return kRefused;
        case programs::Trouble::kCancelled:
            return kCancelled;
        case programs::Trouble::kFailed:
        case programs::Trouble::kBusy:
            break;
    }
    return kFailed;
}

ExitCode Fail(ExitCode code, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    fputs("zelctl: ", stderr);
    vfprintf(stderr, format, arguments);
    fputc('\n', stderr);
    va_end(arguments);
    return code;
}

}  // namespace zelctl
