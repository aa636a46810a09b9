#pragma once

#include <string>

namespace programs {

/// Reads a password: from the first line of `file` ("-": standard input) or, when `file` is empty,
/// from the terminal without echo. Throws Failure (kUsage) when it cannot be read.
std::string ReadPassword(const std::string& file, const std::string& prompt);

/// The same for a new password: at the terminal it is asked for twice, until both entries match.
std::string ReadNewPassword(const std::string& file, const std::string& prompt);

/// Asks at the terminal; what was typed, empty at its end.
std::string Ask(const std::string& question);

/// Asks at the terminal; true when the answer is yes.
bool Confirm(const std::string& question);

}  // namespace programs
