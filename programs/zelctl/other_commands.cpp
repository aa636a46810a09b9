#include "programs/zelctl/declare.h"
#include "programs/zelctl/doctor/doctor.h"
#include "programs/zelctl/task/edit.h"
#include "programs/zelctl/task/run.h"
#include "programs/zelctl/task/transfer.h"

namespace zelctl {

void DeclareStatus(CLI::App& status) {
    static bool as_json = false;
    status.add_flag("--json", as_json, "Write JSON, for programs");
    status.callback([] { ShowDaemonStatus(as_json); });
}

void DeclareReload(CLI::App& reload) {
    reload.callback([] { ReloadDaemon(); });
}

void DeclareDoctor(CLI::App& doctor) {
    static bool as_json = false;
    doctor.add_flag("--json", as_json, "Write JSON, for programs");
    doctor.footer(
        "It changes nothing. Exit code 0: nothing has failed; 3: something has.\n"
        "As root it sees what the daemon sees.");
    doctor.callback([] { Doctor(as_json); });
}

void DeclareExport(CLI::App& exporting) {
    static std::string path;
    static bool with_passwords = false;
    exporting.add_option("file", path, "Where to (standard output)");
    exporting.add_flag("--with-passwords", with_passwords,
                       "With the accounts' passwords; the file then is yours alone to read");
    exporting.callback([] { ExportTasks(path, with_passwords); });
}

void DeclareImport(CLI::App& importing) {
    static std::string path;
    static std::string password_file;
    static bool replace = false;
    importing.add_option("file", path, "What 'zelctl export' wrote ('-': standard input)")
        ->required();
    importing.add_flag("--replace", replace,
                       "Tasks that are there already become those of the file");
    importing.add_option("--password-file", password_file,
                         "File with the password of all accounts whose password the file does not "
                         "have; else each is asked for");
    importing.footer(
        "Nothing is imported unless every task of the file is possible here. Shares that\n"
        "they need and this machine has not are added, where their folders are there.");
    importing.callback([] { ImportTasks(path, replace, password_file); });
}

void DeclareVerify(CLI::App& verify) {
    static std::string task;
    static std::string share;
    static std::vector<std::string> paths;
    verify.add_option("task", task, "The task")->required();
    verify.add_option("paths", paths, "Only these, as they are called in the share");
    verify.add_option("--share", share, "Only this share of the task")->option_text("NAME");
    verify.footer(
        "Every file is read at both ends, which takes as long as the disks do, and nothing is\n"
        "changed. DAMAGED: size and time are the same, the bytes are not; one of the two is\n"
        "damaged. What differs otherwise is sent with the task's next run. Exit code 1: something\n"
        "differs.");
    verify.callback([] { VerifyTask(task, share, paths); });
}

}  // namespace zelctl
