// Takes a folder of which nothing is recorded into the registry, as a share's copy.
#pragma once

#include <optional>
#include <string>

namespace zel_server {

/// `zel_server shares --adopt FOLDER [--account NAME]`: the folder, which lies in a storage folder,
/// becomes the copy of the share that is called like it. It belongs to the account or, when that is
/// empty, to whoever pushes the share next. Throws Failure when it cannot be a copy, or is one.
void AdoptCopy(const std::string& folder, const std::string& account);

/// The folder in which files of that share lie, though nothing is recorded of them.
std::optional<std::string> UnrecordedFolderOf(const std::string& share);

}  // namespace zel_server
