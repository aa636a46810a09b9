#include "programs/zel_server/share_module.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <sstream>

#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/text.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/rsyncd_config.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;

constexpr size_t kMaxModuleFile = 65536;
constexpr char kSuffix[] = ".conf";
constexpr char kAccountLine[] = "# account = ";
constexpr char kClientLine[] = "# client = ";
constexpr char kPathLine[] = "    path = ";

bool IsRoot() {
    return geteuid() == 0;
}

std::string FileOf(const std::string& share) {
    return ShareModules() + "/" + share + kSuffix;
}

// Whether files there can keep owners, modes and special files in extended attributes. A disk that
// is full at the moment says nothing about that.
bool KeepsAttributes(const std::string& folder) {
    const char value[] = "1";
    if (setxattr(folder.c_str(), "user.zel.probe", value, 1, 0) != 0) {
        return errno != ENOTSUP;
    }
    removexattr(folder.c_str(), "user.zel.probe");
    return true;
}

// What stands behind `beginning` in a line that begins so.
std::optional<std::string> Rest(const std::string& line, const std::string& beginning) {
    return line.compare(0, beginning.size(), beginning) == 0
               ? std::optional<std::string>(line.substr(beginning.size()))
               : std::nullopt;
}

}  // namespace

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
                      const ShareState& state) {
    std::ostringstream text;
    text << kAccountLine << state.account << "\n"
         << kClientLine << state.Owner() << "\n"
         << "[" << state.module << "]\n"
         << kPathLine << state.path << "\n"
         << "    list = no\n"
         << "    read only = no\n"
         << "    auth users = *\n"
         << "    secrets file = " << SecretsFile() << "\n"
         << "    pre-xfer exec = " << ExecLine(config, "admit-transfer") << "\n"
         << "    post-xfer exec = " << ExecLine(config, "end-transfer") << "\n"
         << "    numeric ids = yes\n";
    if (KeepsAttributes(state.path)) {
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
    return base::ReadFile(FileOf(share), kMaxModuleFile) == text.str() ||
           base::ReplaceFile(FileOf(share), text.str(), 0644);
}

bool HasShareModule(const std::string& share) {
    struct stat info = {};
    // What cannot be looked at is not taken for absent: then a share could seem to be new.
    return lstat(FileOf(share).c_str(), &info) == 0 || (errno != ENOENT && errno != ENOTDIR);
}

std::optional<ShareModule> ReadShareModule(const std::string& share) {
    const auto text = base::ReadFile(FileOf(share), kMaxModuleFile);
    if (!text) {
        return std::nullopt;
    }
    ShareModule read;
    std::optional<std::string> account;
    std::optional<std::string> client;
    std::istringstream lines(*text);
    for (std::string line; std::getline(lines, line);) {
        if (const auto named = Rest(line, kAccountLine)) {
            account = named;
        } else if (const auto behind = Rest(line, kClientLine)) {
            client = behind;
        } else if (const auto folder = Rest(line, kPathLine)) {
            read.path = *folder;
        } else if (line.size() > 2 && line.front() == '[' && line.back() == ']') {
            read.module = line.substr(1, line.size() - 2);
        }
    }
    if (ShareOfModule(read.module) != share || read.path.empty()) {
        return std::nullopt;
    }
    // An account without a client, or the other way round, is nobody that there ever was.
    read.names_owner = account && client && account->empty() == client->empty() &&
                       (account->empty() || (IsAccountName(*account) && IsClientId(*client)));
    if (read.names_owner) {
        read.account = *account;
        read.client = *client;
    }
    return read;
}

std::optional<std::vector<std::string>> SharesWithModule() {
    std::vector<std::string> shares;
    std::error_code error;
    fs::directory_iterator entry(ShareModules(), error);
    for (; !error && entry != fs::directory_iterator(); entry.increment(error)) {
        const fs::path name = entry->path().filename();
        if (name.extension() == kSuffix && IsShareName(name.stem())) {
            shares.push_back(name.stem());
        }
    }
    if (error && error != std::errc::no_such_file_or_directory) {
        return std::nullopt;
    }
    std::sort(shares.begin(), shares.end());
    return shares;
}

}  // namespace zel_server
