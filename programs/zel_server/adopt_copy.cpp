#include "programs/zel_server/adopt_copy.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>

#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zel_server/accounts.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/storage.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;
using programs::Failure;
using programs::Printable;

std::string Quoted(const std::string& name) {
    return "'" + Printable(name) + "'";
}

Failure NoCopy(const std::string& folder, const std::string& why) {
    return Failure(Quoted(folder) + " cannot become a copy: " + why);
}

void RequireAccount(const std::string& name) {
    const auto accounts = Accounts();
    if (!accounts || std::none_of(accounts->begin(), accounts->end(),
                                  [&](const Account& account) { return account.name == name; })) {
        throw Failure("there is no account " + Quoted(name) + ": see 'zel_server account list'");
    }
}

bool IsFolderOfCopies(const ServerConfig& config, const std::string& path) {
    const auto owner = OwnerOfCopies(config);
    struct stat info = {};
    return owner && lstat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode) &&
           info.st_uid == owner->uid;
}

}  // namespace

void AdoptCopy(const std::string& folder, const std::string& account) {
    const ServerConfig config = RequireServerConfig();
    fs::path path = fs::absolute(folder).lexically_normal();
    path = path.has_filename() ? path : path.parent_path();
    const std::vector<std::string> storage = config.Folders();
    if (std::find(storage.begin(), storage.end(), path.parent_path()) == storage.end()) {
        throw NoCopy(path, "it must lie straight in a storage folder: move it into " +
                               Printable(config.storage));
    }
    const std::string module = path.filename();
    const std::string share = ShareOfModule(module);
    if (!IsShareName(share)) {
        throw NoCopy(path, "no share can have its name");
    }
    if (!IsFolderOfCopies(config, path)) {
        throw NoCopy(path, "it must be a folder that belongs to " +
                               (config.user.empty() ? "the user who runs the server"
                                                    : "the user " + Quoted(config.user)));
    }
    if (!account.empty()) {
        RequireAccount(account);
    }
    const RegistryLock lock;
    ShareState state;
    const ReadResult read = lock.Held() ? ReadShare(share, state) : ReadResult::kFailed;
    if (read == ReadResult::kFailed) {
        throw programs::SystemFailure("cannot read the registry " + RegistryFile());
    }
    if (read != ReadResult::kMissing || IsNameOfAnother(share)) {
        throw NoCopy(path,
                     "there is a share of that name: 'zel_server shares' and 'zel_server "
                     "repair' tell of it");
    }
    state.module = module;
    state.path = path;
    state.account = account;
    state.last_result = kMended;
    if (!WriteShare(share, state) || !WriteShareRecord(share, state, {})) {
        throw programs::SystemFailure("cannot write the registry " + RegistryFile() + " or " +
                                      ShareRecords());
    }
    printf("%s is the copy of share %s. It belongs to %s; the next push compares all of it.\n",
           path.c_str(), Quoted(share).c_str(),
           account.empty() ? "the client and account that push it next"
                           : ("account " + Quoted(account)).c_str());
}

std::optional<std::string> UnrecordedFolderOf(const std::string& share) {
    ShareState state;
    if (!IsShareName(share) || ReadShare(share, state) != ReadResult::kMissing) {
        return std::nullopt;
    }
    const ServerConfig config = RequireServerConfig();
    for (const std::string& folder : config.Folders()) {
        for (const std::string& module : {share, "@" + share + "@"}) {
            std::string path = folder + "/";
            path += module;
            if (IsFolderOfCopies(config, path)) {
                return path;
            }
        }
    }
    return std::nullopt;
}

}  // namespace zel_server
