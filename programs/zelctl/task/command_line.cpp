#include "programs/common/schedule_words.h"
#include "programs/common/task_fields.h"
#include "programs/zelctl/base/setting_option.h"
#include "programs/zelctl/declare.h"
#include "programs/zelctl/task/edit.h"
#include "programs/zelctl/task/list.h"
#include "programs/zelctl/task/next.h"
#include "programs/zelctl/task/run.h"

namespace zelctl {

namespace {

using programs::TaskField;

constexpr char kScheduleHelp[] =
    "It runs by one of --manual, --on-change, --weekly, --monthly, --yearly, --once.\n"
    "The last four run at --at, and with --every and --times again on the same day:\n"
    "    --weekly weekdays --at 08:00 --every 2h --times 3\n"
    "runs at 08:00, 10:00, 12:00 and 14:00.";

/// The arguments of `task add` and `task edit`.
struct TaskArguments {
    std::string name;
    programs::ScheduleWords schedule;
    EditOptions options;

    const EditOptions& Options() {
        programs::SayWords(schedule, options.said);
        return options;
    }
};

void AddScheduleOptions(CLI::App& command, programs::ScheduleWords& words, bool is_new) {
    const char* const group = "When it runs";
    command.add_flag("--manual", words.manual, "Only when asked to")->group(group);
    command.add_flag("--on-change", words.on_change, "As soon as something has changed")
        ->group(group);
    command
        .add_option("--weekly", words.weekly,
                    "On these days: mon,thu or monday,thursday; daily, weekdays, weekends")
        ->option_text("DAYS")
        ->group(group);
    command
        .add_option("--monthly", words.monthly,
                    "On this day of each month; where a month has no such day, as many days into "
                    "the next one as are missing: 31 is May 1 for April")
        ->option_text("DAY")
        ->group(group);
    command.add_option("--yearly", words.yearly, "On this date of each year; 02-29 is March 1")
        ->option_text("MM-DD")
        ->group(group);
    command.add_option("--once", words.once, "On this date alone")
        ->option_text("YYYY-MM-DD")
        ->group(group);
    command.add_option("--at", words.at, "When a day's first run begins")
        ->default_str(is_new ? "00:00" : "")
        ->option_text("HH:MM")
        ->group(group);
    command.add_option("--every", words.every, "Time between a day's runs: 90m, 2h or 1h30m")
        ->option_text("TIME")
        ->group(group);
    command
        .add_option("--times", words.times,
                    "How many runs follow the first one on the same day: 3 makes 4 runs; 0: none")
        ->option_text("NUMBER")
        ->check(programs::WholeNumber())
        ->group(group);
}

CLI::App* AddNamed(CLI::App& task, const char* command, const char* about, std::string& name) {
    CLI::App* const added = task.add_subcommand(command, about);
    added->add_option("name", name, "The task's name")->required();
    return added;
}

CLI::App* AddChanging(CLI::App& task, const char* command, const char* about,
                      TaskArguments& arguments, bool is_new) {
    CLI::App* const added = AddNamed(task, command, about, arguments.name);
    EditOptions& options = arguments.options;
    for (const TaskField& field : programs::TaskFields()) {
        if (field.option != nullptr) {
            AddSetting(*added, field, options.said, is_new);
        }
    }
    AddTrustOptions(*added, options.trust);
    added->add_option("--password-file", options.password_file,
                      "File with the account's password ('-': standard input)");
    added->add_flag("--no-check", options.no_check,
                    "Do not ask the server whether it takes the account and the shares");
    AddScheduleOptions(*added, arguments.schedule, is_new);
    added->footer(kScheduleHelp);
    return added;
}

// Declares a command whose only argument is the task's name.
void DeclareTelling(CLI::App& task, std::string& name, const char* command, const char* about,
                    const char* request, const char* done) {
    AddNamed(task, command, about, name)->callback([&name, request, done] {
        TellTask(request, name, done);
    });
}

void DeclareChanging(CLI::App& task, TaskArguments& arguments) {
    AddChanging(task, "add", "Add a task", arguments, true)->callback([&arguments] {
        AddTask(arguments.name, arguments.Options());
    });
    CLI::App* const edit = AddChanging(
        task, "edit", "Change a task; what is not given stays as it is", arguments, false);
    edit->add_option_function<std::string>(
            "--rename",
            [&arguments](const std::string& name) { arguments.options.said["name"] = name; },
            "Another name for it")
        ->option_text("NAME");
    edit->add_flag("--password", arguments.options.new_password, "Ask for another password");
    edit->callback([&arguments] { EditTask(arguments.name, arguments.Options()); });
}

void DeclareRun(CLI::App& task) {
    static std::vector<std::string> names;
    static bool wait = false;
    static bool dry_run = false;
    CLI::App* const run = task.add_subcommand("run", "Run tasks now");
    run->add_option("names", names, "The tasks")->required();
    run->add_flag("-w,--wait", wait,
                  "Show how far they are, and exit by their results; Ctrl-C leaves them running");
    run->add_flag("-n,--dry-run", dry_run, "Only list what would be sent and deleted")
        ->excludes("--wait");
    run->callback([] { dry_run ? ListTaskChanges(names) : RunTasks(names, wait); });
}

}  // namespace

void DeclareTask(CLI::App& task) {
    static TaskArguments arguments;
    static bool as_json = false;
    static unsigned int limit = 20;
    static unsigned int count = 10;
    std::string& name = arguments.name;
    task.require_subcommand(1);

    DeclareChanging(task, arguments);
    CLI::App* const list = task.add_subcommand("list", "List the tasks");
    list->add_flag("--json", as_json, "Write JSON, for programs");
    list->callback([] { as_json ? ListTasksAsJson() : ListTasks(); });

    CLI::App* const show = AddNamed(task, "show", "Show all of a task", name);
    show->add_flag("--json", as_json, "Write JSON, for programs");
    show->callback([] { ShowTask(name, as_json); });

    DeclareRun(task);
    DeclareTelling(task, name, "rm", "Remove a task; shares and copies stay", "task_remove",
                   "is removed; its shares and their copies stay");
    DeclareTelling(task, name, "confirm",
                   "Let go once what a task waits with; 'task show' lists what would be lost",
                   "task_confirm",
                   "runs as soon as a worker is free, and may do once what it asked");
    DeclareTelling(task, name, "cancel", "End a task's run, or take it back", "task_cancel",
                   "does not run any more");
    DeclareTelling(task, name, "pause", "Run a task only when asked to, until resumed",
                   "task_pause", "is paused: it runs when you ask for it alone");
    DeclareTelling(task, name, "resume", "Let a paused task run by its schedule again",
                   "task_resume", "runs by its schedule again");

    CLI::App* const log = AddNamed(task, "log", "Show a task's runs, newest first", name);
    log->add_option("--limit", limit, "How many")
        ->option_text("NUMBER")
        ->check(programs::Between(1, 200))
        ->capture_default_str();
    log->add_flag("--json", as_json, "Write JSON, for programs");
    static bool details = false;
    log->add_flag("--verbose", details, "Show what rsync and ssh wrote about each failure, too");
    log->callback([] { ShowTaskLog(name, limit, details, as_json); });

    CLI::App* const next = AddNamed(task, "next", "Show when a task runs next", name);
    next->add_option("--count", count, "How many runs to show")
        ->option_text("NUMBER")
        ->check(programs::Between(1, 1000))
        ->capture_default_str();
    next->add_flag("--json", as_json, "Write JSON, for programs");
    next->callback([] { ShowTaskRuns(name, count, as_json); });

    CLI::App* const watch = task.add_subcommand("watch", "Show what tasks are doing, until Ctrl-C");
    watch->add_option("name", name, "The task (all)");
    watch->callback([] { WatchTasks(name); });
}

void DeclareNext(CLI::App& next) {
    static programs::ScheduleWords words;
    static NextOptions options;
    AddScheduleOptions(next, words, true);
    next.add_option("--count", options.count, "How many runs to show")
        ->option_text("NUMBER")
        ->check(programs::Between(1, 1000))
        ->capture_default_str();
    next.add_option("--from", options.from,
                    "Moment to count from, 'YYYY-MM-DD HH:MM' (now unless given)")
        ->option_text("MOMENT");
    next.add_flag("--json", options.as_json, "Write JSON, for programs");
    next.footer(kScheduleHelp);
    next.callback([] {
        programs::SayWords(words, options.said);
        ShowNextRuns(options);
    });
}

}  // namespace zelctl
