#include "programs/zel_server/rsyncd_config.h"

#include <sys/wait.h>
#include <unistd.h>

#include <sstream>

#include "base/child_process.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/text.h"
#include "programs/zel_server/answers.h"
#include "programs/zel_server/connections.h"
#include "tarq/root_path.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

constexpr size_t kMaxFile = 65536;
constexpr char kSearchPath[] = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";
constexpr int kSyntaxError = 1;  // rsync's exit code

// Whether the installed rsync knows the parameter. It would log an unknown one at each connection.
bool RsyncKnows(const std::string& parameter) {
    base::ChildSetup probe;
    probe.program = base::FindProgram("rsync", kSearchPath);
    probe.arguments = {"rsync",
                       "--server",
                       "--daemon",
                       "--config=/dev/null",
                       "--dparam=" + parameter,
                       "--log-file=/dev/null",
                       "."};
    probe.environment = {"LC_ALL=C"};
    const base::ChildResult result = base::RunChild(probe, nullptr, nullptr, nullptr);
    return result.start_error == 0 && WIFEXITED(result.wait_status) &&
           WEXITSTATUS(result.wait_status) != kSyntaxError;
}

// No run sees the folder for versions, sends anything to it or deletes there. The second pattern is
// for what is below, which rsync compares by itself. It leaves out the folders of the runs, which
// --backup-dir names.
//
// Nor does any run see the folder for partial files. What is below it is not left out: rsync keeps
// no partial file in a place that is.
const std::string kHidden = std::string("/") + TARQ::Backup::kVersionsFolder + " /" +
                            TARQ::Backup::kVersionsFolder + "/*/** /" +
                            TARQ::Backup::kPartialsFolder;

// By itself it leads nowhere: its path is a link that begin-push makes for this one connection, to
// the copy of the share that it has admitted. rsync follows none in the path of a module without a
// chroot, so there is no such module then.
std::string PushModule(const ServerConfig& config) {
    std::ostringstream text;
    text << "\n[" << TARQ::Backup::kPushModule << "]\n"
         << "    comment = pushes of the synchronisation service in one connection\n"
         << "    path = " << PushLinks() << "/%" << kConnectionVariable << "%\n"
         << "    list = no\n"
         << "    read only = no\n"
         << "    auth users = *\n"
         << "    secrets file = " << SecretsFile() << "\n"
         << "    early exec = " << ExecLine(config, "begin-push") << "\n"
         << LinesOfCopy(config, true);
    return text.str();
}

}  // namespace

std::string LinesOfCopy(const ServerConfig& config, bool keeps_attributes) {
    std::ostringstream text;
    text << "    pre-xfer exec = " << ExecLine(config, "admit-transfer") << "\n"
         << "    post-xfer exec = " << ExecLine(config, "end-transfer") << "\n"
         << "    numeric ids = yes\n"
         << "    exclude = " << kHidden << "\n";
    if (keeps_attributes) {
        text << "    fake super = yes\n";
    } else {
        // The client then omits these options, and says so. The modes of the files themselves are
        // still kept, but special ones do not let a program run as the user of the copies.
        text << "    refuse options = acls xattrs\n"
             << "    incoming chmod = ug-s\n";
    }
    if (geteuid() == 0) {
        const std::string user = config.user.empty() ? "root" : config.user;
        text << "    uid = " << user << "\n    gid = *\n    use chroot = yes\n";
    } else {
        text << "    use chroot = no\n";
    }
    return text.str();
}

std::string ExecLine(const ServerConfig& config, const char* operation) {
    const std::string root = TARQ::RootFolder();
    return (root.empty() ? "" : "TARQ_ROOT='" + root + "' ") + "exec '" + config.program + "' " +
           operation;
}

bool WriteRsyncdConfig(const ServerConfig& config) {
    std::ostringstream text;
    // No modules of others: rsync merges two modules of the same name, and would use the folder of
    // one for the other.
    text << "# Written by 'zel_server setup' and 'zel_server serve', which starts an rsync daemon "
            "for each connection, with the modules that are open then.\n"
         << "# Modules of your own belong to the system's rsync daemon.\n"
         << "log file = " << RsyncdLog() << "\n"
         << "reverse lookup = no\n"
         << "proxy protocol = yes\n"
         << "lock file = " << AnswerFolder() << "/.connections\n"
         << "max connections = " << kMaxConnections << "\n"
         << "timeout = " << kSilentSeconds << "\n";
    // The connection is a Unix socket, which has no address; only the front can open it.
    for (const char* parameter : {"proxy protocol hosts=*", "auth digest=sha256"}) {
        if (RsyncKnows(parameter)) {
            text << parameter << "\n";
        }
    }
    text << "\n"
         << "[" << TARQ::Backup::kCommandModule << "]\n"
         << "    comment = commands of the synchronisation service\n"
         << "    path = " << AnswerFolder() << "/%RSYNC_USER_NAME%\n"
         << "    list = no\n"
         << "    read only = yes\n"
         << "    auth users = *\n"
         << "    secrets file = " << SecretsFile() << "\n"
         << "    early exec = " << ExecLine(config, "handle-command") << "\n"
         << "    post-xfer exec = " << ExecLine(config, "end-transfer") << "\n";
    if (geteuid() == 0) {
        // Commands are executed earlier, as root (early exec). The module itself only delivers the
        // answer.
        text << "    uid = " << kAnswerUser << "\n    gid = " << kAnswerUser
             << "\n    use chroot = yes\n"
             << PushModule(config);
    } else {
        text << "    use chroot = no\n";
    }
    // Not rewritten when it is up to date.
    return base::ReadFile(RsyncdConfig(), kMaxFile) == text.str() ||
           base::ReplaceFile(RsyncdConfig(), text.str(), 0640);
}

bool IsPlainPath(const std::string& path) {
    if (path.empty() || path.front() != '/' || path.find_first_of("'\"%\\") != std::string::npos) {
        return false;
    }
    return programs::Printable(path) == path && path.back() != ' ';
}

}  // namespace zel_server
