#include "programs/zel_server/versions_guard.h"

#include <unistd.h>

#include "base/code_folder.h"
#include "programs/common/failure.h"

namespace zel_server {

std::string VersionsGuard() {
    std::string guard = base::FolderOfCode(reinterpret_cast<const void*>(&VersionsGuard)) +
                        "/libzel_versions_guard.so";
    if (access(guard.c_str(), R_OK) != 0) {
        throw programs::SystemFailure(guard +
                                      ", a part of zel_server, cannot be read: install it again");
    }
    return guard;
}

}  // namespace zel_server
