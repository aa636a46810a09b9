#include "programs/common/failure.h"
#include "programs/zelctl/declare.h"
#include "programs/zelctl/restore/recover.h"
#include "programs/zelctl/restore/restore.h"
#include "programs/zelctl/restore/versions.h"

namespace zelctl {

namespace {

// A task, or a server with an account: the first word is the task's name unless a server is given.
void CheckTask(const ConnectionOptions& connection, std::string& task,
               std::vector<std::string>& paths) {
    const bool has_server = connection.said.hasMember("server_name");
    if (has_server != connection.said.hasMember("user")) {
        throw programs::Failure(programs::FailureKind::kUsage,
                                "--server and --user go together; for a task say neither");
    }
    if (has_server && !task.empty()) {
        paths.insert(paths.begin(), task);
        task.clear();
    }
    if (!has_server && task.empty()) {
        throw programs::Failure(programs::FailureKind::kUsage,
                                "which task? Without one: --share, --server and --user");
    }
}

void AddSource(CLI::App& command, std::string& task, std::vector<std::string>& paths,
               ConnectionOptions& connection, std::string& share) {
    command.add_option("task", task, "The task; with --server there is none");
    command.add_option("paths", paths, "Paths of the share; none: all of it");
    connection.AddTo(&command, {"max_bandwidth"});
    command.get_option("--server")->required(false);
    command.get_option("--user")->required(false);
    command.add_option("--share", share, "The share; may be left out for a task with only one");
}

}  // namespace

void DeclareRestore(CLI::App& restore) {
    static RestoreOptions options;
    restore.add_option("--to", options.folder, "The folder to restore into; made if missing")
        ->required()
        ->option_text("FOLDER");
    AddSource(restore, options.task, options.paths, options.connection, options.share);
    restore
        .add_option("--at", options.at, "As the share stood then, local time; else as it is now")
        ->option_text("'YYYY-MM-DD HH:MM[:SS]'");
    restore.add_flag("--overwrite", options.overwrite,
                     "Replace files that are in the folder and differ; else they stay");
    restore.add_flag("-n,--dry-run", options.dry_run, "Only list what would be restored");
    restore.add_flag("-q,--quiet", options.quiet, "Say nothing but errors");
    restore.footer(
        "Nothing is deleted, here or at the server. A task that pushes the folder is paused "
        "first.\n"
        "As root, owners and devices come back as well. 'zelctl versions' lists times for --at.");
    restore.callback([] {
        CheckTask(options.connection, options.task, options.paths);
        Restore(options);
    });
}

void DeclareRecover(CLI::App& recover) {
    static RecoverOptions options;
    static bool list = false;
    static bool as_json = false;
    options.connection.AddTo(&recover);
    recover
        .add_option("--from", options.from,
                    "The client that was lost, by its identity or name; needed when there are "
                    "several")
        ->option_text("CLIENT");
    recover
        .add_option("--at", options.at,
                    "Configuration and files as they stood then, local time; else as they are now")
        ->option_text("'YYYY-MM-DD HH:MM[:SS]'");
    recover.add_flag("-y,--yes", options.yes, "Bring all shares back without asking");
    CLI::Option* const listing =
        recover.add_flag("--list", list, "Only list what clients have left at the server");
    recover.add_flag("--json", as_json, "Write JSON, for programs")->needs(listing);
    recover.footer(
        "Adds the tasks and shares of a machine that was lost, as it left them with its server,\n"
        "and brings the files back. Tasks are paused until then. What is here already stays.\n"
        "Called again, it goes on where it broke off.");
    recover.callback([] { list ? ListDeposits(options, as_json) : Recover(options); });
}

void DeclareVersions(CLI::App& versions) {
    static VersionsOptions options;
    static std::vector<std::string> paths;
    AddSource(versions, options.task, paths, options.connection, options.share);
    versions.add_flag("--json", options.as_json, "Write JSON, for programs");
    versions.callback([] {
        CheckTask(options.connection, options.task, paths);
        if (paths.size() > 1) {
            throw programs::Failure(programs::FailureKind::kUsage, "only one path at a time");
        }
        options.path = paths.empty() ? "" : paths.front();
        ShowVersions(options);
    });
}

}  // namespace zelctl
