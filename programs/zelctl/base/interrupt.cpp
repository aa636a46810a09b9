#include "programs/zelctl/base/interrupt.h"

#include <signal.h>

#include <initializer_list>

namespace zelctl {

namespace {

std::atomic<bool> interrupted{false};
int interrupt_flag = 0;  // the same as an abort flag for channels; accessed atomically
static_assert(std::atomic<bool>::is_always_lock_free, "set in a signal handler");

extern "C" void Note(int) {
    interrupted = true;
    __atomic_store_n(&interrupt_flag, 1, __ATOMIC_RELAXED);
}

}  // namespace

void WatchForInterrupt() {
    struct sigaction action = {};
    action.sa_handler = Note;
    // The default action is restored after the first signal, so that a second one ends the program.
    action.sa_flags = static_cast<int>(SA_RESETHAND);
    sigemptyset(&action.sa_mask);
    for (const int number : {SIGINT, SIGTERM, SIGHUP}) {
        sigaction(number, &action, nullptr);
    }
}

void StopWatchingForInterrupt() {
    for (const int number : {SIGINT, SIGTERM, SIGHUP}) {
        signal(number, SIG_DFL);
    }
}

const std::atomic<bool>& Interrupted() {
    return interrupted;
}

int* InterruptFlag() {
    return &interrupt_flag;
}

}  // namespace zelctl
