#include "programs/zelctl/interrupt.h"

#include <signal.h>

#include <cstdarg>
#include <cstdio>
#include <initializer_list>

#include "programs/zelctl/exit_codes.h"

namespace zelctl {

namespace {

int interrupted = 0;  // a whole int, for those who take it as an abort flag

extern "C" void Note(int) {
    __atomic_store_n(&interrupted, 1, __ATOMIC_RELAXED);
}

}  // namespace

void WatchForInterrupt() {
    struct sigaction action = {};
    action.sa_handler = Note;
    // The default comes back after the first: a person who insists is obeyed.
    action.sa_flags = static_cast<int>(SA_RESETHAND);
    sigemptyset(&action.sa_mask);
    for (const int number : {SIGINT, SIGTERM, SIGHUP}) {
        sigaction(number, &action, nullptr);
    }
}

bool Interrupted() {
    return __atomic_load_n(&interrupted, __ATOMIC_RELAXED) != 0;
}

int* InterruptFlag() {
    return &interrupted;
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
