#include "base/random_digits.h"

#include <sys/random.h>

#include <array>

namespace base {

namespace {

constexpr size_t kBytes = 16;
constexpr char kDigits[] = "0123456789abcdef";

}  // namespace

std::string RandomDigits() {
    std::array<unsigned char, kBytes> bytes;
    // Up to 256 bytes come whole or not at all.
    if (getrandom(bytes.data(), bytes.size(), 0) != static_cast<ssize_t>(bytes.size())) {
        return "";
    }
    std::string digits;
    for (const unsigned char byte : bytes) {
        digits += kDigits[byte >> 4];
        digits += kDigits[byte & 15];
    }
    return digits;
}

bool AreRandomDigits(std::string_view text) {
    return text.size() == 2 * kBytes && text.find_first_not_of(kDigits) == std::string_view::npos;
}

}  // namespace base
