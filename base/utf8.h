#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace base {

/// How many bytes the character at text[at] has, and which it is; 0 when none begins there: no
/// overlong forms, no surrogates, nothing above U+10FFFF. REQUIRES at < text.size().
size_t Utf8Character(std::string_view text, size_t at, uint32_t* code);

/// Whether `text` is valid UTF-8.
bool IsUtf8(const std::string& text);

/// The first characters of `text` that have at most `bytes` bytes together: cut where one begins.
std::string_view Utf8Head(std::string_view text, size_t bytes);

}  // namespace base
