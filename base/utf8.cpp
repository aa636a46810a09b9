#include "base/utf8.h"

#include <cstddef>
#include <cstdint>

namespace base {

bool IsUtf8(const std::string& text) {
    // The smallest code point that a sequence of this many bytes may stand for.
    constexpr uint32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
    for (size_t i = 0; i < text.size();) {
        const auto lead = static_cast<unsigned char>(text[i]);
        const size_t length = lead < 0x80         ? 1
                              : lead >> 5 == 0x6  ? 2
                              : lead >> 4 == 0xe  ? 3
                              : lead >> 3 == 0x1e ? 4
                                                  : 0;
        if (length == 0 || length > text.size() - i) {
            return false;
        }
        uint32_t code = length == 1 ? lead : lead & (0x7fU >> length);
        for (size_t j = 1; j < length; ++j) {
            const auto byte = static_cast<unsigned char>(text[i + j]);
            if (byte >> 6 != 0x2) {
                return false;
            }
            code = code << 6 | (byte & 0x3fU);
        }
        if (code < kSmallest[length] || code > 0x10ffff || (code >= 0xd800 && code <= 0xdfff)) {
            return false;
        }
        i += length;
    }
    return true;
}

}  // namespace base
