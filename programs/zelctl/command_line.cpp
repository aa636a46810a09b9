#include "programs/zelctl/command_line.h"

#include <CLI/CLI.hpp>
#include <cstring>

#include "ZEL/log.h"
#include "programs/common/text.h"
#include "programs/zelctl/cli.h"

namespace {

using namespace zelctl;

struct Command {
    const char* name;
    const char* about;
    void (*declare)(CLI::App& app, ExitCode& result);
};

constexpr Command kCommands[] = {
    {"task", "Tasks: shares that the daemon keeps in step with a server", DeclareTask},
    {"share", "The folders of this machine that may be pushed", DeclareShare},
    {"status", "What the daemon is doing", DeclareStatus},
    {"reload", "Let the daemon read its configuration again", DeclareReload},
    {"doctor", "Look at all that a push needs, and say how to mend what is wrong", DeclareDoctor},
    {"export", "Write all tasks to a file", DeclareExport},
    {"import", "Add the tasks of a file", DeclareImport},
    {"pair", "Pairing with a server", DeclarePair},
    {"push", "Push shares to a server now, without the daemon", DeclarePush},
    {"next", "Show the next runs of a schedule", DeclareNext},
};

// The first word that is no option: the command, if there is one.
const char* CommandOf(int argc, char** argv) {
    for (int i = 1; i < argc; ++i) {
        if (argv[i][0] != '-') {
            return argv[i];
        }
    }
    return "";
}

}  // namespace

int RunCommandLine(int argc, char** argv) {
    CLI::App app{"Keeps shared folders in step with a paired server"};
    app.name("zelctl");
    app.require_subcommand(1);
    app.add_flag_callback(
        "-v,--verbose",
        [] { ZEL::Logger::Initialize(ZEL::Logger::STDERR, ZEL::Logger::LEVEL_INFO, "", 0); },
        "Write the library's log to standard error instead of the system log");
    ExitCode result = kOk;
    const char* const wanted = CommandOf(argc, argv);
    bool known = *wanted == '\0';
    for (const Command& command : kCommands) {
        CLI::App* const declared = app.add_subcommand(command.name, command.about);
        // What another command takes need not be known to run this one.
        if (strcmp(command.name, wanted) == 0) {
            command.declare(*declared, result);
            known = true;
        }
    }
    if (!known) {
        return Fail(kUsage, "there is no command '%s': 'zelctl -h' lists them",
                    programs::Printable(wanted).c_str());
    }
    app.footer(
        "'zelctl COMMAND -h' tells more.\n"
        "Exit codes: 0 done, 1 failed on the way, 2 wrong usage, 3 a problem on this machine,\n"
        "4 the server refuses, 5 ended by the user.");
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        return app.exit(error) == 0 ? kOk : kUsage;
    }
    return result;
}
