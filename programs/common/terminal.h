#pragma once

#include <optional>
#include <string>

namespace programs {

/// A password: from the first line of `file` ("-": standard input), or, when `file` is empty, typed
/// at the terminal without echo. Nothing when there is none to be had; the reason is then in
/// `error`.
std::optional<std::string> ReadPassword(const std::string& file, const std::string& prompt,
                                        std::string& error);

/// The same for a password that is set here: one that is typed is asked for twice, until both are
/// the same.
std::optional<std::string> ReadNewPassword(const std::string& file, const std::string& prompt,
                                           std::string& error);

/// Asks at the terminal; true when the answer is yes.
bool Confirm(const std::string& question);

}  // namespace programs
