#include "programs/zel_server/rsyncd_config.h"

#include <unistd.h>

#include <sstream>

#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/text.h"
#include "tarq/root_path.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

constexpr size_t kMaxFile = 65536;

}  // namespace

std::string ExecLine(const ServerConfig& config, const char* operation) {
    const std::string root = TARQ::RootFolder();
    return (root.empty() ? "" : "TARQ_ROOT='" + root + "' ") + "exec '" + config.program + "' " +
           operation;
}

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
    if (geteuid() == 0) {
        text << "    uid = root\n    gid = root\n    use chroot = yes\n";
    } else {
        text << "    use chroot = no\n";
    }
    text << "\n&include " << ShareModules() << "\n&include " << AdminModules() << "\n";
    // Its time tells whether the daemon that runs knows it.
    return base::ReadFile(RsyncdConfig(), kMaxFile) == text.str() ||
           base::ReplaceFile(RsyncdConfig(), text.str(), 0644);
}

bool IsPlainPath(const std::string& path) {
    if (path.empty() || path.front() != '/' || path.find_first_of("'\"%\\") != std::string::npos) {
        return false;
    }
    return programs::Printable(path) == path && path.back() != ' ';
}

}  // namespace zel_server
