#pragma once

#include <optional>
#include <string>
#include <vector>

namespace base {

/// The names in the open folder `folder`, without "." and "..", in no order. The position of the
/// caller's descriptor does not matter and stays as it is. Nothing, with errno set, when the folder
/// cannot be read to its end.
std::optional<std::vector<std::string>> NamesIn(int folder);

}  // namespace base
