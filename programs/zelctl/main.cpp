#include <cstring>

#include "programs/common/command_line.h"
#include "programs/common/failure.h"
#include "programs/zelctl/task/quick_list.h"

int main(int argc, char** argv) {
    const bool is_list = argc == 3 && strcmp(argv[1], "task") == 0 && strcmp(argv[2], "list") == 0;
    if (is_list && zelctl::PrintTaskListQuickly()) {
        return 0;
    }
    return programs::RunFromLibrary("zelctl", "libzelctl_commands.so",
                                    programs::ExitStatusOf(programs::FailureKind::kLocal), argc,
                                    argv);
}
