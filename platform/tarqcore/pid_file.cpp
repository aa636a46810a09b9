#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <climits>
#include <optional>
#include <string>
#include <string_view>

#include "base/text.h"
#include "base/unique_fd.h"
#include "platform/internal/error.h"

using base::UniqueFd;

namespace {

// A pid file holds a number of at most ten digits and a line break; /proc/<pid>/stat names the
// state within its first 64 bytes or so (pid, name of at most 64 bytes in brackets, state).
constexpr size_t kPidFileBytes = 64;
constexpr size_t kStatBytes = 256;

/// The start of a file; nothing when it cannot be read.
template <size_t Size>
std::optional<std::string_view> ReadStart(const char* path, char (&buffer)[Size]) {
    const UniqueFd fd(open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    const ssize_t n = fd ? read(fd.Get(), buffer, Size) : -1;
    if (n < 0) {
        return std::nullopt;
    }
    return std::string_view(buffer, static_cast<size_t>(n));
}

/// The pid on the file's first line; 0 when there is anything else on it, or no end to it.
pid_t ParsePid(std::string_view text) {
    const size_t line_break = text.find('\n');
    if (line_break == std::string_view::npos && text.size() == kPidFileBytes) {
        return 0;
    }
    const std::string_view line = base::Trimmed(text.substr(0, line_break), " \t\r");
    return static_cast<pid_t>(base::ParseNumber(line, INT_MAX).value_or(0));
}

/// Whether the process is a zombie. False when that cannot be determined.
bool IsZombie(pid_t pid) {
    char buffer[kStatBytes];
    const auto stat = ReadStart(("/proc/" + std::to_string(pid) + "/stat").c_str(), buffer);
    if (!stat) {
        return false;
    }
    const size_t name_end = stat->rfind(") ");  // the name itself may hold anything
    if (name_end == std::string_view::npos || name_end + 2 >= stat->size()) {
        return false;
    }
    const char state = (*stat)[name_end + 2];
    return state == 'Z' || state == 'X';
}

}  // namespace

int KAPICProcAliveByPidFile(const char* path) {
    if (path == nullptr) {
        return 0;
    }
    return tarq_internal::Guarded(0, [&] {
        char buffer[kPidFileBytes];
        const auto text = ReadStart(path, buffer);
        const pid_t pid = text ? ParsePid(*text) : 0;
        // EPERM also proves that the process exists.
        const bool exists = pid > 0 && (kill(pid, 0) == 0 || errno == EPERM);
        return exists && !IsZombie(pid) ? 1 : 0;
    });
}
