#pragma once

#include <string>

namespace base {

/// Whether there is a folder at `path` itself (not a link to one) that belongs to root or to the
/// caller, and in which nobody else can replace or remove what the caller puts there.
bool IsOwnFolder(const std::string& path);

}  // namespace base
