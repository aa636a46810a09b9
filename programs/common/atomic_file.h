#pragma once

#include <sys/types.h>

#include <string>

namespace programs {

/// Writes a whole file so that after a crash the old one or the new one is there. False, with errno
/// set, on failure.
bool WriteFileAtomically(const std::string& path, const std::string& content, mode_t mode);

}  // namespace programs
