#pragma once

#include <string>

namespace base {

/// The folder of the program or library that has the code at `address`, a function's; by its real
/// path. Empty when that cannot be told.
std::string FolderOfCode(const void* address);

}  // namespace base
