#include "platform/internal/proc_stat.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <charconv>
#include <string>
#include <string_view>

#include "platform/internal/unique_fd.h"

namespace tarq_internal {

std::optional<ProcStat> ReadProcStat(pid_t pid) {
    const std::string path = "/proc/" + std::to_string(pid) + "/stat";
    const UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    std::array<char, 512> buffer;
    const ssize_t count = fd ? read(fd.Get(), buffer.data(), buffer.size()) : -1;
    if (count <= 0) {
        return std::nullopt;
    }
    // "123 (name) S 45 ...": the name may hold anything, so its end is found from behind.
    const std::string_view text(buffer.data(), static_cast<size_t>(count));
    const size_t name_end = text.rfind(") ");
    if (name_end == std::string_view::npos || text.size() < name_end + 5) {
        return std::nullopt;
    }
    ProcStat result;
    result.state = text[name_end + 2];
    std::from_chars(text.data() + name_end + 4, text.data() + text.size(), result.parent);
    return result;
}

}  // namespace tarq_internal
