#include "base/utf8.h"

namespace base {

size_t Utf8Character(std::string_view text, size_t at, uint32_t* code) {
    // The smallest code point that a sequence of this many bytes may stand for.
    constexpr uint32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
    const auto lead = static_cast<unsigned char>(text[at]);
    const size_t length = lead < 0x80         ? 1
                          : lead >> 5 == 0x6  ? 2
                          : lead >> 4 == 0xe  ? 3
                          : lead >> 3 == 0x1e ? 4
                                              : 0;
    if (length == 0 || length > text.size() - at) {
        return 0;
    }
    uint32_t found = length == 1 ? lead : lead & (0x7fU >> length);
    for (size_t i = 1; i < length; ++i) {
        const auto byte = static_cast<unsigned char>(text[at + i]);
        if (byte >> 6 != 0x2) {
            return 0;
        }
        found = found << 6 | (byte & 0x3fU);
    }
    if (found < kSmallest[length] || found > 0x10ffff || (found >= 0xd800 && found <= 0xdfff)) {
        return 0;
    }
    *code = found;
    return length;
}

bool IsUtf8(const std::string& text) {
    uint32_t code = 0;
    for (size_t i = 0, length = 0; i < text.size(); i += length) {
        length = Utf8Character(text, i, &code);
        if (length == 0) {
            return false;
        }
    }
    return true;
}

std::string_view Utf8Head(std::string_view text, size_t bytes) {
    if (text.size() <= bytes) {
        return text;
    }
    size_t end = bytes;
    for (int i = 0; i < 3 && end > 0 && (static_cast<unsigned char>(text[end]) & 0xc0) == 0x80;
         ++i) {
        --end;
    }
    // Bytes that are no UTF-8 have no better place.
    const bool begins = (static_cast<unsigned char>(text[end]) & 0xc0) != 0x80;
    return text.substr(0, begins ? end : bytes);
}

}  // namespace base
