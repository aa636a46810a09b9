#include "programs/common/command_line.h"

#include "ZEL/log.h"
#include "programs/common/failure.h"
#include "programs/common/help.h"
#include "programs/common/text.h"
#include "programs/zelctl/declare.h"
#include "programs/zelctl/server/become.h"

namespace {

using namespace zelctl;

struct Command {
    const char* name;
    const char* about;
    void (*declare)(CLI::App& app);
};

constexpr Command kCommands[] = {
    {"task", "Tasks: shares that the daemon keeps in step with a server", DeclareTask},
    {"share", "The folders of this machine that may be pushed", DeclareShare},
    {"status", "What the daemon is doing", DeclareStatus},
    {"reload", "Let the daemon read its configuration again", DeclareReload},
    {"doctor", "Look at all that a push needs, and say how to mend what is wrong", DeclareDoctor},
    {"export", "Write all tasks and shares to a file", DeclareExport},
    {"import", "Add the tasks of a file", DeclareImport},
    {"trust", "The servers that are trusted, and how each is reached", DeclareTrust},
    {"pair", "Pairing with a server", DeclarePair},
    {"push", "Push shares to a server now, without the daemon", DeclarePush},
    {"restore", "Bring files back from the server", DeclareRestore},
    {"recover", "Take a machine that was lost back from its server", DeclareRecover},
    {"versions", "When a share has changed at the server", DeclareVersions},
    {"verify", "Compare a task's shares and their copies byte by byte", DeclareVerify},
    {"next", "Show the next runs of a schedule", DeclareNext},
    {"server", "The server on this machine: all that zel_server does", nullptr},
};

// The first word from `words[index]` on that is not an option, and the position after it; empty
// when there is none.
std::string NextWord(const std::vector<std::string>& words, size_t& index) {
    while (index < words.size()) {
        const std::string& word = words[index++];
        if (!word.empty() && word.front() != '-') {
            return word;
        }
    }
    return "";
}

// `below`: the unknown word after the command group `word`; empty: `word` itself is unknown.
programs::Failure NoSuchCommand(const std::string& word, const std::string& below) {
    const std::string group = below.empty() ? "" : word + " ";
    return {programs::FailureKind::kUsage,
            "there is no command '" + programs::Printable(below.empty() ? word : group + below) +
                "': 'zelctl " + group + "-h' lists them"};
}

void Run(const std::vector<std::string>& words) {
    CLI::App app{"Keeps shared folders in step with a paired server"};
    app.name("zelctl");
    programs::SpeakPlainly(app, true);
    app.require_subcommand(1);
    app.set_version_flag("--version", ZEL_VERSION, "Show the version");
    app.add_flag_callback(
        "-v,--verbose",
        [] { ZEL::Logger::Initialize(ZEL::Logger::STDERR, ZEL::Logger::LEVEL_INFO, "", 0); },
        "Write the library's log to standard error instead of the system log");
    size_t index = 0;
    const std::string wanted = NextWord(words, index);
    if (wanted == "server") {
        BecomeServer({words.begin() + static_cast<std::ptrdiff_t>(index), words.end()});
    }
    bool known = wanted.empty();
    for (const Command& command : kCommands) {
        CLI::App* const declared = app.add_subcommand(command.name, command.about);
        // Only the wanted command declares its options; the others would cost time.
        if (wanted == command.name) {
            command.declare(*declared);
            known = true;
            const std::string below = NextWord(words, index);
            if (declared->get_require_subcommand_min() > 0 && !below.empty() &&
                declared
                    ->get_subcommands(
                        [&](const CLI::App* lower) { return lower->check_name(below); })
                    .empty()) {
                throw NoSuchCommand(wanted, below);
            }
        }
    }
    if (!known) {
        throw NoSuchCommand(wanted, "");
    }
    app.footer(
        "'zelctl help COMMAND' tells more.\n"
        "Exit codes: 0 done, 1 failed on the way, 2 wrong usage, 3 a problem on this\n"
        "machine, 4 the server refuses, 5 ended by the user.");
    programs::Parse(app, words);
}

}  // namespace

int RunCommandLine(int argc, char** argv) {
    return programs::RunReporting("zelctl", [&] { Run(programs::CommandWords(argc, argv)); });
}
