// Reading and writing all at once.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace base {

/// What is left to read from the open descriptor `fd`; nothing, with errno set, when it cannot be
/// read or is more than `max` bytes (EFBIG).
std::optional<std::string> ReadAll(int fd, size_t max = SIZE_MAX);

/// The content of the file at `path`, under the same rules.
std::optional<std::string> ReadFile(const std::string& path, size_t max = SIZE_MAX);

/// Writes all of `bytes` to the open descriptor `fd`. False with errno set when it cannot.
bool WriteAll(int fd, std::string_view bytes);

}  // namespace base
