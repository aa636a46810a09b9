#pragma once

#include <string>

#include "base/unique_fd.h"

namespace TARQ {
namespace Backup {

/// What one run's programs may read and nobody else: a file that no folder has, so that nothing of
/// it is left when this process ends, however it does. A program that this process starts, and
/// those that that one starts, open it by its path, as long as this object lives.
class SecretFile {
public:
    SecretFile() = default;
    /// Throws PrivateFileError.
    explicit SecretFile(const std::string& content);

    /// Empty for none.
    std::string Path() const;

private:
    base::UniqueFd file_;
};

}  // namespace Backup
}  // namespace TARQ
