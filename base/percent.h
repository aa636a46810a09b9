#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace base {

/// The byte as it stands in a text that may hold letters, digits and the bytes of `plain` alone;
/// any other byte as "%41".
std::string PercentEncoded(char byte, std::string_view plain);
std::string PercentEncoded(std::string_view text, std::string_view plain);

/// The bytes of such a text; nothing when a "%" is not followed by two digits (0-9, a-f).
std::optional<std::string> PercentDecoded(std::string_view text);

}  // namespace base
