#include "platform/tarqrsync/helper_program.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/code_folder.h"
#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

std::string HelperProgram(const std::string& name) {
    std::string program =
        base::FolderOfCode(reinterpret_cast<const void*>(&HelperProgram)) + "/tarqrsync/" + name;
    if (access(program.c_str(), X_OK) != 0) {
        throw ServersError("the program " + program +
                           ", a part of this library, cannot be run: " + strerror(errno));
    }
    return program;
}

}  // namespace Backup
}  // namespace TARQ
