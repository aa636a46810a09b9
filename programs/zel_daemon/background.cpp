#include "programs/zel_daemon/background.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <system_error>
#include <utility>

namespace zel_daemon {

namespace {

using base::UniqueFd;

// The starter: 0 once the daemon is ready, what it ended with otherwise.
[[noreturn]] void WaitForReady(UniqueFd ready, pid_t daemon) {
    char byte = 0;
    ssize_t count = 0;
    while ((count = read(ready.Get(), &byte, 1)) < 0 && errno == EINTR) {
    }
    int status = 0;
    if (count != 1) {
        while (waitpid(daemon, &status, 0) < 0 && errno == EINTR) {
        }
        _exit(WIFEXITED(status) && WEXITSTATUS(status) != 0 ? WEXITSTATUS(status) : 1);
    }
    _exit(0);
}

}  // namespace

Background::Background() {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) {
        throw std::system_error(errno, std::generic_category(), "pipe");
    }
    UniqueFd reading(ends[0]);
    ready_ = UniqueFd(ends[1]);
    const pid_t child = fork();
    if (child < 0) {
        throw std::system_error(errno, std::generic_category(), "fork");
    }
    if (child > 0) {
        ready_.Reset();
        WaitForReady(std::move(reading), child);
    }
    setsid();
}

void Background::Ready() {
    const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
    if (null >= 0) {
        for (const int fd : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
            dup2(null, fd);
        }
        close(null);
    }
    if (chdir("/") != 0) {
        // It stays where it was started; nothing depends on it.
    }
    const char byte = 1;
    while (write(ready_.Get(), &byte, 1) < 0 && errno == EINTR) {
    }
    ready_.Reset();
}

}  // namespace zel_daemon
