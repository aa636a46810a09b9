#include "base/text.h"

#include <charconv>

namespace base {

std::string Lower(std::string text) {
    for (char& c : text) {
        c = Lower(c);
    }
    return text;
}

std::string_view Trimmed(std::string_view text, std::string_view blanks) {
    const size_t first = text.find_first_not_of(blanks);
    return first == std::string_view::npos
               ? std::string_view()
               : text.substr(first, text.find_last_not_of(blanks) - first + 1);
}

std::optional<uint64_t> ParseNumber(std::string_view text, uint64_t max) {
    uint64_t number = 0;
    const char* const end = text.data() + text.size();
    const auto [stopped, error] = std::from_chars(text.data(), end, number);
    if (error != std::errc() || stopped != end || number > max) {
        return std::nullopt;
    }
    return number;
}

}  // namespace base
