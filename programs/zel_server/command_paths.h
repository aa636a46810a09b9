// Paths below a share, as a command has them.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace zel_server {

/// A path: a value holds no quotes and no control characters, so these are percent-encoded
/// (base/percent.h). Empty is the share itself. Nothing for one that leads out of the share, or
/// that has empty names.
std::optional<std::string> ParsePath(const std::string& value);

/// Paths with blanks between them; none when `text` is null. Nothing for a text that is no such
/// list, or where one of them is the share itself or reserved in it.
std::optional<std::vector<std::string>> ParsePaths(const std::string* text);

}  // namespace zel_server
