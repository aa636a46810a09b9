// The order of a share's paths: a folder, then what is below it, then what comes after.
#pragma once

#include <string>
#include <string_view>

namespace zel_daemon {

/// A path of a share ("/photos/a.jpg", "/" for all of it) as a text whose bytes sort in that order:
/// each name with a NUL before it, and nothing for the share itself. No name holds a NUL, and as
/// the lowest byte it makes what is below a folder follow it directly.
std::string KeyOf(const std::string& path);
std::string PathOf(std::string key);

/// Whether the key is the folder's or that of something below it.
bool IsWithin(std::string_view key, std::string_view folder);

/// The key of the folder that it is in. REQUIRES that it is not the share's.
std::string_view ParentOf(std::string_view key);

}  // namespace zel_daemon
