#include "platform/internal/config.h"

#include <fcntl.h>
#include <tarq/core.h>
#include <tarq/owners.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

#include "base/unique_fd.h"

namespace tarq_internal {
namespace {

using base::UniqueFd;

constexpr int kHashCapacity = 16;

}  // namespace

ReadResult ReadSection(const std::string& path, const std::string& section, Section* values) {
    if (KAPICFileExist(path.c_str()) == 0) {
        return ReadResult::kAbsent;
    }
    const TARQ::HashOwner hash(KAPICSzHashAlloc(kHashCapacity));
    if (!hash) {
        return ReadResult::kFailed;
    }
    const int result = KAPICFileGetSection(path.c_str(), section.c_str(), hash.get());
    if (result <= 0) {
        return result == 0 ? ReadResult::kAbsent : ReadResult::kFailed;
    }
    const char* key = nullptr;
    const char* value = nullptr;
    for (int position = 0; KAPICSzHashNext(hash.get(), &position, &key, &value) == 1;) {
        (*values)[key] = value;
    }
    return ReadResult::kFound;
}

ReadResult ReadValue(const std::string& path, const std::string& section, const std::string& key,
                     std::string* value) {
    Section values;
    const ReadResult result = ReadSection(path, section, &values);
    if (result != ReadResult::kFound) {
        return result;
    }
    const auto found = values.find(key);
    if (found == values.end()) {
        return ReadResult::kAbsent;
    }
    *value = found->second;
    return ReadResult::kFound;
}

std::string ValueOf(const Section& section, const std::string& key) {
    const auto found = section.find(key);
    return found == section.end() ? std::string() : found->second;
}

std::optional<std::string> ReadTextFile(const std::string& path) {
    const UniqueFd file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file) {
        return std::nullopt;
    }
    std::string text;
    std::array<char, 4096> buffer;
    for (;;) {
        const ssize_t got = read(file.Get(), buffer.data(), buffer.size());
        if (got == 0) {
            return text;
        }
        if (got > 0) {
            text.append(buffer.data(), static_cast<size_t>(got));
        } else if (errno != EINTR) {
            return std::nullopt;
        }
    }
}

std::string Trimmed(const std::string& text) {
    const std::string blanks(" \t\r\n\0", 5);
    const size_t first = text.find_first_not_of(blanks);
    if (first == std::string::npos) {
        return {};
    }
    return text.substr(first, text.find_last_not_of(blanks) - first + 1);
}

bool CopyOut(const std::string& text, char* buffer, int size) {
    if (buffer == nullptr || size <= 0) {
        return false;
    }
    if (text.size() >= static_cast<size_t>(size)) {
        buffer[0] = '\0';
        return false;
    }
    memcpy(buffer, text.c_str(), text.size() + 1);
    return true;
}

}  // namespace tarq_internal
