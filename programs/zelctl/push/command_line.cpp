#include "programs/zelctl/declare.h"
#include "programs/zelctl/push/push.h"
#include "programs/zelctl/task/next.h"

namespace zelctl {

void DeclarePair(CLI::App& pair) {
    static ConnectionOptions connection;
    static std::vector<std::string> shares;
    pair.require_subcommand(1);
    CLI::App* const check =
        pair.add_subcommand("check", "Ask whether the server would take shares from this client");
    check->add_option("shares", shares, "The shares")->required();
    connection.AddTo(check);
    check->callback([] { CheckPairing(connection, shares); });
}

void DeclarePush(CLI::App& push) {
    static PushOptions options;
    push.add_option("shares", options.shares, "The shares")->required();
    options.connection.AddTo(&push);
    push.add_option("--path", options.path, "Only this path of the share, beginning with /")
        ->check([](const std::string& path) {
            return path.empty() || path.front() != '/'
                       ? std::string("a path of a share begins with /")
                       : "";
        });
    push.add_option("--exclude", options.excludes,
                    "rsync pattern of files that stay behind (may be repeated)")
        ->option_text("PATTERN");
    push.add_option("--bwlimit", options.bandwidth_limit, "Limit in KiB a second (0: none)")
        ->option_text("KIB")
        ->check(programs::WholeNumber());
    push.add_flag("-n,--dry-run", options.dry_run, "Only list what would be sent and deleted");
    push.add_flag("-q,--quiet", options.quiet, "Say nothing but errors");
    push.callback([] { Push(options); });
}

void DeclareNext(CLI::App& next) {
    static NextOptions options;
    next.add_option("--mode", options.mode, "manual, realtime, weekly, monthly, yearly or once")
        ->capture_default_str();
    next.add_option("--week", options.week, "Weekdays, Sunday first, 1 for a run day")
        ->option_text("DAYS")
        ->capture_default_str();
    next.add_option("--begin", options.begin, "Date whose day, month or year counts")
        ->option_text("YYYY-MM-DD")
        ->capture_default_str();
    next.add_option("--start", options.start, "Time of the first run of a day")
        ->option_text("HH:MM")
        ->capture_default_str();
    next.add_option("--repeat", options.repeat, "Further runs on the same day")
        ->option_text("NUMBER")
        ->check(programs::Between(0, 95))
        ->capture_default_str();
    next.add_option("--period", options.period, "Time between them")
        ->option_text("HH:MM")
        ->capture_default_str();
    next.add_option("--count", options.count, "How many runs to show")
        ->option_text("NUMBER")
        ->check(programs::Between(1, 1000))
        ->capture_default_str();
    next.add_option("--from", options.from,
                    "Moment to count from, 'YYYY-MM-DD HH:MM' (now unless given)")
        ->option_text("MOMENT");
    next.add_flag("--json", options.as_json, "Write JSON, for programs");
    next.callback([] { ShowNextRuns(options); });
}

}  // namespace zelctl
