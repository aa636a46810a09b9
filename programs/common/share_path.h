#pragma once

#include <optional>
#include <string>

namespace programs {

/// A path of a share as a person wrote it ("/2024/", "2024//a.jpg"), relative and without steps
/// that lead nowhere: "2024/a.jpg"; empty for the share itself. Nothing for one that has a ".." or
/// a NUL.
std::optional<std::string> PathInShare(const std::string& written);

/// The same; throws Failure (kUsage) where there is nothing.
std::string RequirePathInShare(const std::string& written);

/// The folder that a path of a share ("/2024/a.jpg") is in: "/2024", and "/" for "/2024".
std::string FolderAbove(const std::string& path);

/// Whether a path of a share ("2024/a.jpg" or "/2024/a.jpg") is at or below a name that is the
/// service's own: see TARQ::Backup::kReservedNames.
bool IsReservedInShare(const std::string& path);

/// Whether something may be moved from such a path, relative to the share, or to it: neither it nor
/// a name above it is the service's own.
bool IsMovableInShare(const std::string& path);

}  // namespace programs
