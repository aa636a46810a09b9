#include "base/open_beneath.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>

namespace base {

UniqueFd OpenBeneath(int folder, const std::string& path, int flags) {
    open_how how = {};
    how.flags = static_cast<unsigned int>(flags | O_NOFOLLOW | O_CLOEXEC);
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
    const char* const below = path.empty() ? "." : path.c_str();
    return UniqueFd(static_cast<int>(syscall(SYS_openat2, folder, below, &how, sizeof how)));
}

}  // namespace base
