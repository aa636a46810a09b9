#include "platform/tarqrsync/secret_file.h"

#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include "base/whole_file.h"
#include "platform/tarqrsync/private_folder.h"

namespace TARQ {
namespace Backup {

SecretFile::SecretFile(const std::string& content) : file_(memfd_create("tarqrsync", MFD_CLOEXEC)) {
    if (!file_ || fchmod(file_.Get(), 0600) != 0 || !base::WriteAll(file_.Get(), content)) {
        throw PrivateFileError("cannot keep a secret in memory");
    }
}

std::string SecretFile::Path() const {
    return file_ ? "/proc/" + std::to_string(getpid()) + "/fd/" + std::to_string(file_.Get()) : "";
}

}  // namespace Backup
}  // namespace TARQ
