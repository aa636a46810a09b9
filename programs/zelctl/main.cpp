#include <CLI/CLI.hpp>

#include "ZEL/log.h"
#include "programs/zelctl/next.h"
#include "programs/zelctl/push.h"
#include "programs/zelctl/shares.h"

namespace {

using namespace zelctl;

void AddShareCommands(CLI::App& app, ExitCode& result) {
    CLI::App* const share =
        app.add_subcommand("share", "The folders of this machine that may be pushed");
    share->require_subcommand(1);
    static std::string name;
    static std::string path;
    static bool acl = false;
    static bool windows = false;
    static bool as_json = false;

    CLI::App* const add = share->add_subcommand("add", "Add a folder as a share");
    add->add_option("name", name, "The share's name")->required();
    add->add_option("folder", path, "The folder")->required();
    add->add_flag("--acl", acl, "Its files carry access control lists");
    add->add_flag("--windows", windows, "It is shared with Windows clients");
    add->callback([&result] { result = AddShare(name, path, acl, windows); });

    CLI::App* const list = share->add_subcommand("list", "List the shares");
    list->add_flag("--json", as_json, "Write JSON, for programs");
    list->callback([&result] { result = ListShares(as_json); });

    CLI::App* const remove =
        share->add_subcommand("rm", "Take a share out of the catalogue; its files stay");
    remove->add_option("name", name, "The share's name")->required();
    remove->callback([&result] { result = RemoveShare(name); });
}

void AddPairCommands(CLI::App& app, ExitCode& result) {
    static ConnectionOptions connection;
    static std::vector<std::string> shares;
    CLI::App* const pair = app.add_subcommand("pair", "Pairing with a server");
    pair->require_subcommand(1);
    CLI::App* const check =
        pair->add_subcommand("check", "Ask whether the server would take shares from this client");
    check->add_option("shares", shares, "The shares")->required();
    connection.AddTo(check);
    check->callback([&result] { result = CheckPairing(connection, shares); });
}

void AddPushCommand(CLI::App& app, ExitCode& result) {
    static PushOptions options;
    CLI::App* const push = app.add_subcommand("push", "Push shares to a server now");
    push->add_option("shares", options.shares, "The shares")->required();
    options.connection.AddTo(push);
    push->add_option("--path", options.path, "Only this path of the share, beginning with /")
        ->check([](const std::string& path) {
            return path.empty() || path.front() != '/'
                       ? std::string("a path of a share begins with /")
                       : "";
        });
    push->add_option("--exclude", options.excludes,
                     "rsync pattern of files that stay behind (may be repeated)");
    push->add_option("--bwlimit", options.bandwidth_limit, "Limit in KiB a second (0: none)");
    push->add_flag("-n,--dry-run", options.dry_run, "Only list what would be sent and deleted");
    push->add_flag("-q,--quiet", options.quiet, "Say nothing but errors");
    push->callback([&result] { result = Push(options); });
}

void AddNextCommand(CLI::App& app, ExitCode& result) {
    static NextOptions options;
    CLI::App* const next = app.add_subcommand("next", "Show the next runs of a schedule");
    next->add_option("--mode", options.mode, "manual, realtime, weekly, monthly, yearly or once")
        ->capture_default_str();
    next->add_option("--week", options.week, "Weekdays, Sunday first, 1 for a run day")
        ->capture_default_str();
    next->add_option("--begin", options.begin, "Date whose day, month or year counts")
        ->capture_default_str();
    next->add_option("--start", options.start, "Time of the first run of a day")
        ->capture_default_str();
    next->add_option("--repeat", options.repeat, "Further runs on the same day")
        ->check(CLI::Range(0, 95))
        ->capture_default_str();
    next->add_option("--period", options.period, "Time between them")->capture_default_str();
    next->add_option("--count", options.count, "How many runs to show")
        ->check(CLI::Range(1, 1000))
        ->capture_default_str();
    next->add_option("--from", options.from, "Moment to count from, 'YYYY-MM-DD HH:MM' (now)");
    next->add_flag("--json", options.as_json, "Write JSON, for programs");
    next->callback([&result] { result = ShowNextRuns(options); });
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{"Keeps shared folders in step with a paired server"};
    app.name("zelctl");
    app.require_subcommand(1);
    app.add_flag_callback(
        "-v,--verbose",
        [] { ZEL::Logger::Initialize(ZEL::Logger::STDERR, ZEL::Logger::LEVEL_INFO, "", 0); },
        "Write the library's log to standard error instead of the system log");
    ExitCode result = kOk;
    AddShareCommands(app, result);
    AddPairCommands(app, result);
    AddPushCommand(app, result);
    AddNextCommand(app, result);
    app.footer(
        "Exit codes: 0 done, 1 failed on the way, 2 wrong usage, 3 a problem on this machine,\n"
        "4 the server refuses, 5 ended by the user.");
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        return app.exit(error) == 0 ? kOk : kUsage;
    }
    return result;
}
