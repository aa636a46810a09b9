#include "base/whole_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>

#include "base/unique_fd.h"

namespace base {

std::optional<std::string> ReadAll(int fd, size_t max) {
    std::string content;
    std::array<char, 16384> buffer;
    for (;;) {
        const ssize_t count = read(fd, buffer.data(), buffer.size());
        if (count == 0) {
            return content;
        }
        if (count < 0 && errno != EINTR) {
            return std::nullopt;
        }
        content.append(buffer.data(), count > 0 ? static_cast<size_t>(count) : 0);
        if (content.size() > max) {
            errno = EFBIG;
            return std::nullopt;
        }
    }
}

std::optional<std::string> ReadFile(const std::string& path, size_t max) {
    const UniqueFd file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    return file ? ReadAll(file.Get(), max) : std::nullopt;
}

bool WriteAll(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t count = write(fd, bytes.data(), bytes.size());
        if (count > 0) {
            bytes.remove_prefix(static_cast<size_t>(count));
        } else if (count == 0) {
            errno = ENOSPC;  // a write of 0 bytes without an error would be retried for ever
            return false;
        } else if (errno != EINTR) {
            return false;
        }
    }
    return true;
}

}  // namespace base
