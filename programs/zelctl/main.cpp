#include <cstring>

#include "programs/common/command_line.h"
#include "programs/common/failure.h"
#include "programs/zelctl/task/list.h"

int main(int argc, char** argv) {
    if (argc == 3 && strcmp(argv[1], "task") == 0 && strcmp(argv[2], "list") == 0) {
        return programs::RunReporting("zelctl", zelctl::ListTasks);
    }
    return programs::RunFromLibrary("zelctl", "libzelctl_commands.so",
                                    programs::ExitStatusOf(programs::FailureKind::kLocal), argc,
                                    argv);
}
