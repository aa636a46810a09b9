#include <dlfcn.h>

#include <cstdio>

#include "programs/common/command_line.h"

namespace programs {

int RunFromLibrary(const char* program, const char* library, int missing, int argc, char** argv) {
    void* const loaded = dlopen(library, RTLD_NOW);
    void* const found = loaded == nullptr ? nullptr : dlsym(loaded, "RunCommandLine");
    if (found == nullptr) {
        fprintf(stderr, "%s: its own library is missing, install it again: %s\n", program,
                dlerror());
        return missing;
    }
    return reinterpret_cast<decltype(&RunCommandLine)>(found)(argc, argv);
}

}  // namespace programs
