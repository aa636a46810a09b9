#pragma once

#include <string>
#include <string_view>

namespace base {

/// 128 random bits as 32 lower-case hexadecimal digits: nobody guesses them, and no two are alike.
/// Empty, with errno set, when the kernel has none to give.
std::string RandomDigits();

/// Whether a text, from wherever, has this form.
bool AreRandomDigits(std::string_view text);

}  // namespace base
