#include "platform/internal/unique_fd.h"

#include <cerrno>

namespace tarq_internal {

void UniqueFd::Reset() {
    if (fd_ >= 0) {
        const int saved = errno;
        close(fd_);
        errno = saved;
        fd_ = -1;
    }
}

}  // namespace tarq_internal
