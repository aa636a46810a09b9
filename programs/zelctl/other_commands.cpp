#include "programs/zelctl/declare.h"
#include "programs/zelctl/doctor/doctor.h"
#include "programs/zelctl/task/edit.h"
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
    importing.footer("Nothing is imported unless every task of the file is possible here.");
    importing.callback([] { ImportTasks(path, replace, password_file); });
}

}  // namespace zelctl
