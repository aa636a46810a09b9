#include "base/open_beneath.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <string_view>

namespace base {

namespace {

UniqueFd OpenInKernel(int folder, const char* path, int flags) {
    open_how how = {};
    how.flags = static_cast<unsigned int>(flags);
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
    return UniqueFd(static_cast<int>(syscall(SYS_openat2, folder, path, &how, sizeof how)));
}

/// Whether the call itself is refused, by an old kernel or by a filter on system calls (systemd's
/// RestrictSUIDSGID= has one, containers have others, and each chooses its own errno). A kernel
/// that supports the call checks the size first.
bool IsRefused() {
    const int saved = errno;
    const bool refused = syscall(SYS_openat2, -1, nullptr, nullptr, 0) == -1 && errno != EINVAL;
    errno = saved;
    return refused;
}

bool GoesUp(std::string_view path) {
    for (size_t at = 0; at <= path.size(); ++at) {
        const size_t end = std::min(path.find('/', at), path.size());
        if (path.substr(at, end - at) == "..") {
            return true;
        }
        at = end;
    }
    return false;
}

/// Opens one name after the other. Each folder on the way is held while the next name is looked up
/// in it, so that whoever puts a link in its place comes too late; a link that is there already is
/// no folder.
UniqueFd Walk(int folder, const std::string& path, int flags) {
    UniqueFd held;
    size_t at = 0;
    for (size_t end = path.find('/'); end != path.npos; end = path.find('/', at)) {
        if (end != at) {
            const int parent = held ? held.Get() : folder;
            held = UniqueFd(openat(parent, path.substr(at, end - at).c_str(),
                                   O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
            if (!held) {
                return held;
            }
        }
        at = end + 1;
    }
    const char* const last = at < path.size() ? path.c_str() + at : ".";
    return UniqueFd(openat(held ? held.Get() : folder, last, flags, 0));
}

}  // namespace

UniqueFd OpenBeneath(int folder, const std::string& path, int flags) {
    static std::atomic<bool> refused{false};
    flags |= O_NOFOLLOW | O_CLOEXEC;
    if (path.substr(0, 1) == "/" || GoesUp(path)) {
        errno = EXDEV;
        return UniqueFd();
    }
    if (!refused) {
        UniqueFd opened = OpenInKernel(folder, path.empty() ? "." : path.c_str(), flags);
        if (opened || !IsRefused()) {
            return opened;
        }
        refused = true;
    }
    return Walk(folder, path, flags);
}

}  // namespace base
