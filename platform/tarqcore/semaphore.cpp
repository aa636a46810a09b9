#include <errno.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <unistd.h>

#include "platform/internal/error.h"

// The semaphore's value counts its holders: 0 is free, which is what the kernel makes it with. So
// there is nothing to initialise after its creation, and no instant at which a second process could
// find it half made.

using tarq_internal::Fail;

namespace {

// Its users are the system's own services, all of one account: the superuser's, or the owner of a
// root folder.
constexpr int kOwnerOnly = 0600;

template <size_t Count>
int Operate(int id, sembuf (&operations)[Count]) {
    int result = 0;
    do {
        result = semop(id, operations, Count);
    } while (result != 0 && errno == EINTR);
    return result == 0 ? 0 : Fail(TARQ_ERR_SEMAPHORE);
}

}  // namespace

int KAPICSemOpen(int key) {
    if (key == IPC_PRIVATE) {  // would make a new one each time, shared with nobody
        errno = EINVAL;
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    const int id = semget(key, 1, IPC_CREAT | kOwnerOnly);
    return id >= 0 ? id : Fail(TARQ_ERR_SEMAPHORE);
}

int KAPICSemLock(int id) {
    // One step for the kernel: nobody comes between the wait and the count.
    sembuf take[] = {{0, 0, 0}, {0, 1, SEM_UNDO}};
    return Operate(id, take);
}

int KAPICSemUnlock(int id) {
    // The last process to operate on a held semaphore is its holder: all others are still waiting.
    const int holder = semctl(id, 0, GETPID);
    if (holder < 0) {
        return Fail(TARQ_ERR_SEMAPHORE);
    }
    if (holder != getpid()) {
        errno = EPERM;
        return Fail(TARQ_ERR_SEMAPHORE);
    }
    sembuf give[] = {{0, -1, SEM_UNDO | IPC_NOWAIT}};
    return Operate(id, give);
}

int KAPICSemClose(int id) {
    if (id < 0) {
        errno = EINVAL;
        return Fail(TARQ_ERR_SEMAPHORE);
    }
    return 0;  // an id is a number, not a handle: nothing is held open
}
