#pragma once

#include <stdexcept>
#include <string>

namespace TARQ {
namespace Backup {

/// A file that a run needs beside it cannot be made.
class PrivateFileError : public std::runtime_error {
public:
    /// `what` failed, for the reason in errno.
    explicit PrivateFileError(const std::string& what);
};

/// A folder in the folder for temporary files (TMPDIR, else /tmp; below the root folder when there
/// is one, its tmp) that only this user can enter, made when it is first needed and removed with
/// all that is in it at the end. It holds what one run must not show to anybody else, but no
/// secret: when this process is killed the folder stays. See SecretFile.
class PrivateFolder {
public:
    PrivateFolder() = default;
    ~PrivateFolder();
    PrivateFolder(const PrivateFolder&) = delete;
    PrivateFolder& operator=(const PrivateFolder&) = delete;

    /// The path of `name` in the folder. Throws PrivateFileError.
    std::string Path(const std::string& name);

    /// Writes a new file that only this user can read. Returns its path. Throws PrivateFileError.
    std::string Write(const std::string& name, const std::string& content);

private:
    std::string folder_;
};

}  // namespace Backup
}  // namespace TARQ
