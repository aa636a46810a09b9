#pragma once

#include <string>

namespace base {

/// Whether `text` is valid UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF.
bool IsUtf8(const std::string& text);

}  // namespace base
