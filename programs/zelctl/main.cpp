// Loads the command line, unless the command is one that can do without.
#include <dlfcn.h>

#include <cstdio>
#include <cstring>

#include "programs/zelctl/command_line.h"
#include "programs/zelctl/exit_codes.h"
#include "programs/zelctl/quick_list.h"

namespace {

constexpr char kLibrary[] = "libzelctl_commands.so";  // found beside the program's libraries

}  // namespace

int main(int argc, char** argv) {
    const bool is_list = argc == 3 && strcmp(argv[1], "task") == 0 && strcmp(argv[2], "list") == 0;
    if (is_list && zelctl::PrintTaskListQuickly()) {
        return zelctl::kOk;
    }
    void* const library = dlopen(kLibrary, RTLD_NOW);
    void* const found = library == nullptr ? nullptr : dlsym(library, "RunCommandLine");
    if (found == nullptr) {
        fprintf(stderr, "zelctl: its own library is missing, install it again: %s\n", dlerror());
        return zelctl::kLocal;
    }
    return reinterpret_cast<decltype(&RunCommandLine)>(found)(argc, argv);
}
