#include "base/percent.h"

#include "base/text.h"

namespace base {

namespace {

constexpr std::string_view kDigits = "0123456789abcdef";

}  // namespace

std::string PercentEncoded(char byte, std::string_view plain) {
    if (IsLetterOrDigit(byte) || plain.find(byte) != std::string_view::npos) {
        return std::string(1, byte);
    }
    const auto value = static_cast<unsigned char>(byte);
    return {'%', kDigits[value >> 4], kDigits[value & 15]};
}

std::string PercentEncoded(std::string_view text, std::string_view plain) {
    std::string encoded;
    for (const char byte : text) {
        encoded += PercentEncoded(byte, plain);
    }
    return encoded;
}

std::optional<std::string> PercentDecoded(std::string_view text) {
    std::string bytes;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') {
            bytes += text[i];
            continue;
        }
        if (i + 2 >= text.size()) {
            return std::nullopt;
        }
        const size_t high = kDigits.find(text[i + 1]);
        const size_t low = kDigits.find(text[i + 2]);
        if (high == std::string_view::npos || low == std::string_view::npos) {
            return std::nullopt;
        }
        bytes += static_cast<char>(high * 16 + low);
        i += 2;
    }
    return bytes;
}

}  // namespace base
