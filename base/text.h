// ASCII text. Not the C library's: a host's locale must not decide which names are the same.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace base {

constexpr char Lower(char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}
/// All of `text` in lower case.
std::string Lower(std::string text);

constexpr bool IsLetter(char c) {
    return Lower(c) >= 'a' && Lower(c) <= 'z';
}
constexpr bool IsLetterOrDigit(char c) {
    return IsLetter(c) || (c >= '0' && c <= '9');
}

/// `text` without blanks, line ends and NULs at either end.
std::string_view Trimmed(std::string_view text,
                         std::string_view blanks = std::string_view(" \t\r\n\0", 5));

/// `text` as a whole number in decimal digits, at most `max`; nothing for any other text.
std::optional<uint64_t> ParseNumber(std::string_view text, uint64_t max);

}  // namespace base
