#include "base/code_folder.h"

#include <dlfcn.h>

#include <filesystem>
#include <system_error>

namespace base {

std::string FolderOfCode(const void* address) {
    Dl_info info = {};
    if (dladdr(address, &info) == 0 || info.dli_fname == nullptr) {
        return "";
    }
    std::error_code error;
    return std::filesystem::canonical(info.dli_fname, error).parent_path();
}

}  // namespace base
