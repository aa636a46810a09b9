#include "programs/zel_server/answers.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <memory>

#include "base/make_folder.h"
#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

namespace {

using base::UniqueFd;

// Much later than any client fetches its answer. Connections that die before that leave one behind.
constexpr time_t kStaleAfter = 600;

struct FolderClose {
    void operator()(DIR* folder) const { closedir(folder); }
};

std::string FolderOf(const std::string& account) {
    return AnswerFolder() + "/" + account;
}

// The daemon's user can open an answer whose name it knows, but cannot list, change or remove any.
constexpr mode_t kAccountFolderMode = 0710;
constexpr mode_t kAnswerMode = 0640;

bool IsRoot() {
    return geteuid() == 0;
}

// A link named after the connection, which points to that connection's answer.
std::string LinkOf(const std::string& account, const std::string& connection) {
    return FolderOf(account) + "/." + connection;
}

// Makes the folder of an account.
bool MakeAccountFolder(const std::string& path) {
    return base::MakeFolder(path, 0700) &&
           (!IsRoot() || (lchown(path.c_str(), 0, kAnswerUser) == 0 &&
                          chmod(path.c_str(), kAccountFolderMode) == 0));
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
    if (!base::MakeFolder(AnswerFolder(), 0700) || !MakeAccountFolder(FolderOf(account))) {
        return false;
    }
    RemoveStale(FolderOf(account));
    return true;
}

bool WriteAnswer(const std::string& account, const std::string& session,
                 const std::string& connection, const Answer& answer) {
    const std::string path = FolderOf(account) + "/" + session;
    const std::string content = "status=\"" + std::to_string(answer.status) + "\"\n" + answer.body;
    // A session is used only once: a file that already exists was planted by somebody.
    const UniqueFd file(
        open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
    const bool readable = file && (!IsRoot() || (fchown(file.Get(), 0, kAnswerUser) == 0 &&
                                                 fchmod(file.Get(), kAnswerMode) == 0));
    return readable && base::WriteAll(file.Get(), content) &&
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
