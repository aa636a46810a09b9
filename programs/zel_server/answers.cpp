#include "programs/zel_server/answers.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <memory>

#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

namespace {

using base::UniqueFd;

// Long after any client has taken its answer; a connection that died before leaves one behind.
constexpr time_t kStaleAfter = 600;

struct FolderClose {
    void operator()(DIR* folder) const { closedir(folder); }
};

std::string FolderOf(const std::string& account) {
    return AnswerFolder() + "/" + account;
}

// A link named by the connection tells which answer is its own.
std::string LinkOf(const std::string& account, const std::string& connection) {
    return FolderOf(account) + "/." + connection;
}

bool MakeFolder(const std::string& path) {
    return mkdir(path.c_str(), 0700) == 0 || errno == EEXIST;
}

void RemoveStale(const std::string& folder) {
    const std::unique_ptr<DIR, FolderClose> entries(opendir(folder.c_str()));
    const time_t now = time(nullptr);
    for (const dirent* entry = nullptr; entries && (entry = readdir(entries.get())) != nullptr;) {
        struct stat info = {};
        if (fstatat(dirfd(entries.get()), entry->d_name, &info, AT_SYMLINK_NOFOLLOW) == 0 &&
            !S_ISDIR(info.st_mode) && now - info.st_mtime > kStaleAfter) {
            unlinkat(dirfd(entries.get()), entry->d_name, 0);
        }
    }
}

}  // namespace

bool PrepareAnswers(const std::string& account) {
    if (!MakeFolder(AnswerFolder()) || !MakeFolder(FolderOf(account))) {
        return false;
    }
    RemoveStale(FolderOf(account));
    return true;
}

bool WriteAnswer(const std::string& account, const std::string& session,
                 const std::string& connection, const Answer& answer) {
    const std::string path = FolderOf(account) + "/" + session;
    const std::string content = "status=\"" + std::to_string(answer.status) + "\"\n" + answer.body;
    // A session is used once: a file that is there already is somebody's mischief.
    const UniqueFd file(
        open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
    return file && base::WriteAll(file.Get(), content) &&
           symlink(session.c_str(), LinkOf(account, connection).c_str()) == 0;
}

void RemoveAnswer(const std::string& account, const std::string& connection) {
    const std::string link = LinkOf(account, connection);
    char session[64];
    const ssize_t length = readlink(link.c_str(), session, sizeof session);
    if (length > 0) {
        unlink(
            (FolderOf(account) + "/" + std::string(session, static_cast<size_t>(length))).c_str());
        unlink(link.c_str());
    }
}

}  // namespace zel_server
