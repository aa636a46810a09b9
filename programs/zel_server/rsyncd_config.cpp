#include "programs/zel_server/rsyncd_config.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <sstream>

#include "programs/common/atomic_file.h"
#include "programs/common/text.h"
#include "tarq/root_path.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

constexpr size_t kMaxModuleFile = 65536;

bool IsRoot() {
    return geteuid() == 0;
}

// An exec line of the daemon, which a shell reads and then is. The root folder is named: the daemon
// may have been started without.
std::string ExecLine(const ServerConfig& config, const char* operation) {
    const std::string root = TARQ::RootFolder();
    return (root.empty() ? "" : "TARQ_ROOT='" + root + "' ") + "exec '" + config.program + "' " +
           operation;
}

// Whether files there can keep owners, modes and special files in extended attributes.
bool KeepsAttributes(const std::string& folder) {
    const char value[] = "1";
    if (setxattr(folder.c_str(), "user.zel.probe", value, 1, 0) != 0) {
        return false;
    }
    removexattr(folder.c_str(), "user.zel.probe");
    return true;
}

}  // namespace

bool WriteRsyncdConfig(const ServerConfig& config) {
    std::ostringstream text;
    text << "# Written by 'zel_server setup'. Modules of your own go into " << AdminModules()
         << "/*.conf\n"
         << "port = " << config.port << "\n";
    if (!config.address.empty()) {
        text << "address = " << config.address << "\n";
    }
    text << "pid file = " << PidFile() << "\n"
         << "log file = " << TARQ::RootPath("/var/log/rsyncd.log") << "\n"
         << "socket options = TCP_NODELAY,SO_KEEPALIVE\n"  // without delays at both ends of a run
         << "reverse lookup = no\n"
         << "\n"
         << "[" << TARQ::Backup::kCommandModule << "]\n"
         << "    comment = commands of the synchronisation service\n"
         << "    path = " << AnswerFolder() << "/%RSYNC_USER_NAME%\n"
         << "    list = no\n"
         << "    read only = yes\n"
         << "    auth users = *\n"
         << "    secrets file = " << SecretsFile() << "\n"
         << "    early exec = " << ExecLine(config, "handle-command") << "\n"
         << "    post-xfer exec = " << ExecLine(config, "end-transfer") << "\n";
    if (IsRoot()) {
        text << "    uid = root\n    gid = root\n    use chroot = yes\n";
    } else {
        text << "    use chroot = no\n";
    }
    text << "\n&include " << ShareModules() << "\n&include " << AdminModules() << "\n";
    return programs::WriteFileAtomically(RsyncdConfig(), text.str(), 0644);
}

bool MakeShareFolder(const ServerConfig& config, const std::string& path) {
    if (mkdir(path.c_str(), 0700) != 0) {
        struct stat info = {};
        return errno == EEXIST && lstat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
    }
    if (!IsRoot() || config.user.empty()) {
        return true;
    }
    const struct passwd* const owner = getpwnam(config.user.c_str());
    return owner != nullptr && chown(path.c_str(), owner->pw_uid, owner->pw_gid) == 0;
}

bool WriteShareModule(const ServerConfig& config, const std::string& share,
                      const std::string& module, const std::string& path) {
    std::ostringstream text;
    text << "[" << module << "]\n"
         << "    path = " << path << "\n"
         << "    list = no\n"
         << "    read only = no\n"
         << "    auth users = *\n"
         << "    secrets file = " << SecretsFile() << "\n"
         << "    pre-xfer exec = " << ExecLine(config, "admit-transfer") << "\n"
         << "    post-xfer exec = " << ExecLine(config, "end-transfer") << "\n"
         << "    numeric ids = yes\n";
    if (KeepsAttributes(path)) {
        text << "    fake super = yes\n";
    } else {
        // The client then sends neither, and says so.
        text << "    refuse options = acls xattrs\n";
    }
    if (IsRoot()) {
        const std::string user = config.user.empty() ? "root" : config.user;
        text << "    uid = " << user << "\n    gid = *\n    use chroot = yes\n";
    } else {
        text << "    use chroot = no\n";
    }
    const std::string file = ShareModules() + "/" + share + ".conf";
    return programs::ReadWholeFile(file, kMaxModuleFile) == text.str() ||
           programs::WriteFileAtomically(file, text.str(), 0644);
}

std::string StartCommand() {
    if (IsRoot() && TARQ::RootFolder().empty()) {
        return "systemctl enable --now zel_rsyncd";
    }
    return "rsync --daemon --config='" + RsyncdConfig() + "'";
}

bool IsPlainPath(const std::string& path) {
    if (path.empty() || path.front() != '/' || path.find_first_of("'\"%\\") != std::string::npos) {
        return false;
    }
    return programs::Printable(path) == path && path.back() != ' ';
}

}  // namespace zel_server
