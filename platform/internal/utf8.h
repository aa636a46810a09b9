#pragma once

#include <string>

namespace tarq_internal {

/// Whether `text` is valid UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF.
bool IsUtf8(const std::string& text);

}  // namespace tarq_internal
