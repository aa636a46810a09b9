#pragma once

#include <string>

namespace programs {

/// A password: from the first line of `file` ("-": standard input), or, when `file` is empty, typed
/// at the terminal without echo. Throws Failure (kUsage) when there is none to be had.
std::string ReadPassword(const std::string& file, const std::string& prompt);

/// The same for a password that is set here: one that is typed is asked for twice, until both are
/// the same.
std::string ReadNewPassword(const std::string& file, const std::string& prompt);

/// Asks at the terminal; true when the answer is yes.
bool Confirm(const std::string& question);

}  // namespace programs
