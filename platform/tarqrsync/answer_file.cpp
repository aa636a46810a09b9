#include "platform/tarqrsync/answer_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <optional>
#include <utility>

#include "base/unique_fd.h"
#include "base/whole_file.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr std::string_view kStatusPrefix = "status=\"";
constexpr std::string_view kStatusSuffix = "\"";
// Nine digits always fit an int.
constexpr size_t kMaxStatusDigits = 9;

bool ParseStatus(std::string_view digits, int* status) {
    if (digits.empty() || digits.size() > kMaxStatusDigits ||
        (digits.size() > 1 && digits[0] == '0') ||
        !std::all_of(digits.begin(), digits.end(), [](char c) { return c >= '0' && c <= '9'; })) {
        return false;
    }
    std::from_chars(digits.data(), digits.data() + digits.size(), *status);
    return true;
}

}  // namespace

bool ParseAnswer(std::string_view text, Answer* answer) {
    const size_t line_end = text.find('\n');
    if (line_end == std::string_view::npos) {
        return false;
    }
    const std::string_view line = text.substr(0, line_end);
    const size_t frame = kStatusPrefix.size() + kStatusSuffix.size();
    if (line.size() < frame || line.substr(0, kStatusPrefix.size()) != kStatusPrefix ||
        line.substr(line.size() - kStatusSuffix.size()) != kStatusSuffix ||
        !ParseStatus(line.substr(kStatusPrefix.size(), line.size() - frame), &answer->status)) {
        return false;
    }
    answer->content = text.substr(line_end + 1);
    return true;
}

bool ReadAnswerFile(const std::string& path, std::string* text) {
    // Without O_NONBLOCK the opening of a FIFO would wait for a writer.
    const base::UniqueFd fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat info;
    if (!fd || fstat(fd.Get(), &info) != 0) {
        return false;
    }
    if (!S_ISREG(info.st_mode)) {
        errno = EINVAL;
        return false;
    }
    std::optional<std::string> content = base::ReadAll(fd.Get(), kMaxAnswerBytes);
    if (content) {
        *text = std::move(*content);
    }
    return content.has_value();
}

bool WriteOutfile(const std::string& path, const std::string& content) {
    const base::UniqueFd fd(open(
        path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600));
    return fd && base::WriteAll(fd.Get(), content);
}

}  // namespace Backup
}  // namespace TARQ
