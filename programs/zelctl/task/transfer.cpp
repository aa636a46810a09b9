#include "programs/zelctl/task/transfer.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <map>
#include <optional>
#include <set>

#include "ZEL/pobject.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/configuration.h"
#include "programs/common/failure.h"
#include "programs/common/task_fields.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/server/connection.h"
#include "programs/zelctl/share/commands.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using ZEL::PObject;

constexpr size_t kMaxFileBytes = size_t{16} << 20;  // a thousand times what a thousand tasks need
constexpr size_t kFaultsShown = 20;
constexpr mode_t kSecretMode = 0600;
constexpr mode_t kPlainMode = 0644;

PObject GetTasks(const char* what_for = nullptr) {
    PObject request;
    request["command"] = "task_list";
    if (what_for != nullptr) {
        request[what_for] = 1;
    }
    return AskDaemon(request);
}

programs::Configuration ReadFileOf(const std::string& path) {
    const auto text = base::ReadFile(path == "-" ? "/dev/stdin" : path, kMaxFileBytes);
    const std::string shown = Printable(path);
    if (!text) {
        throw programs::SystemFailure("cannot read " + shown, FailureKind::kLocal);
    }
    programs::Configuration file = programs::ReadConfiguration(*text);
    for (size_t i = 0; i < file.faults.size() && i < kFaultsShown; ++i) {
        programs::Report("zelctl", shown + ": " + file.faults[i]);
    }
    if (!file.faults.empty()) {
        throw Failure(
            FailureKind::kUsage,
            shown + ": " + programs::Count(file.faults.size(), "fault") + "; nothing was imported");
    }
    return file;
}

/// The tasks of a file that is being imported, and the shares that they need.
class Import {
public:
    Import(programs::Configuration file, bool replace, std::string password_file)
        : tasks_(std::move(file.tasks)),
          replace_(replace),
          password_file_(std::move(password_file)) {
        for (programs::ListedShare& share : file.shares) {
            new_shares_[share.name] = std::move(share);
        }
        for (const std::string& name : ShareNames()) {
            new_shares_.erase(name);
        }
    }

    /// Checks the tasks, and reports what is wrong, at most a screenful.
    void Check() {
        PObject reply = GetTasks();
        for (PObject& task : reply["tasks"].asArray()) {
            const std::string name = static_cast<const PObject&>(task)["name"].asString();
            there_[name].swap(task);
        }
        size_t told = 0;
        std::optional<FailureKind> first;
        for (auto task = tasks_.begin(); task != tasks_.end() && told < kFaultsShown; ++task) {
            try {
                CheckOne(*task);
            } catch (const Failure& failure) {
                programs::Report("zelctl", failure.what());
                first = first.value_or(failure.Kind());
                ++told;
            }
        }
        if (first) {
            throw Failure(*first, "nothing was imported");
        }
    }

    /// Shares that this machine has already stay as they are.
    void AddShares() {
        std::set<std::string> added;
        for (const PObject& task : tasks_) {
            for (const std::string& name : programs::TextsOf(task["share_list"])) {
                const auto share = new_shares_.find(name);
                if (share != new_shares_.end() && added.insert(name).second) {
                    AddShare(name, share->second.folder, share->second.acl, share->second.windows);
                }
            }
        }
    }

    void MeetServers() {
        for (const PObject& task : tasks_) {
            // The trust settings of this machine take precedence over the file.
            const std::string server = programs::ServerOf(task);
            MeetServer(server, IsTrusted(server) ? TrustWish() : WishOf(task, {}));
        }
    }

    void GetPasswords() {
        for (PObject& task : tasks_) {
            GetPassword(task);
        }
    }

    void Send() {
        size_t sent = 0;
        for (PObject& task : tasks_) {
            const PObject& read = task;
            const std::string name = read["name"].asString();
            if (IsThere(name)) {
                task["task"] = name;
            }
            task["command"] = IsThere(name) ? "task_edit" : "task_add";
            try {
                AskDaemon(task);
            } catch (const Failure& failure) {
                programs::Report("zelctl", failure.what());
                throw Failure(failure.Kind(), std::to_string(sent) + " of " +
                                                  std::to_string(tasks_.size()) +
                                                  " tasks are imported; '" + Printable(name) +
                                                  "' and those after it are not");
            }
            ++sent;
        }
        printf("%s imported.\n", programs::Count(sent, "task").c_str());
    }

private:
    bool IsThere(const std::string& name) const { return there_.count(name) != 0; }

    void CheckOne(const PObject& task) const {
        const std::string name = task["name"].asString();
        if (IsThere(name) && !replace_) {
            throw Failure(FailureKind::kLocal,
                          "there is a task '" + Printable(name) +
                              "' already: --replace makes it that of the file");
        }
        try {
            for (const std::string& share : programs::TextsOf(task["share_list"])) {
                CheckShare(share);
            }
        } catch (const Failure& failure) {
            programs::Report("zelctl", failure.what());
            throw Failure(failure.Kind(), "task '" + Printable(name) + "' is not possible");
        }
    }

    void CheckShare(const std::string& name) const {
        const auto found = new_shares_.find(name);
        if (found == new_shares_.end()) {
            CheckShares({name});
            return;
        }
        const programs::ListedShare& share = found->second;
        std::error_code error;
        if (share.encrypted || !std::filesystem::is_directory(share.folder, error)) {
            throw Failure(FailureKind::kLocal,
                          "share '" + Printable(name) +
                              "' is not in the catalogue, and the folder that it was, " +
                              Printable(share.folder) +
                              (share.encrypted ? ", was encrypted" : ", is not there") +
                              ": 'zelctl share add' tells where it is now");
        }
    }

    void GetPassword(PObject& task) {
        const PObject& read = task;
        if (read.hasMember("pswd")) {
            return;
        }
        const auto before = there_.find(read["name"].asString());
        if (before != there_.end() && programs::SameAccount(before->second, read)) {
            return;  // the daemon already has it for the same account
        }
        if (password_file_.empty() || !password_) {
            try {
                password_ = programs::ReadNewPassword(
                    password_file_, "Password of " + Printable(read["user"].asString()) + " on " +
                                        Printable(programs::ServerOf(read)) + " (task '" +
                                        Printable(read["name"].asString()) + "'): ");
            } catch (const Failure& failure) {
                throw Failure(failure.Kind(),
                              std::string(failure.what()) + "; nothing was imported");
            }
        }
        task["pswd"] = *password_;
    }

    std::vector<PObject> tasks_;
    std::map<std::string, programs::ListedShare> new_shares_;  // that this machine has not
    bool replace_;
    std::string password_file_;
    std::optional<std::string> password_;   // the last one read
    std::map<std::string, PObject> there_;  // the daemon's tasks by name
};

// A replaced task takes nothing over: settings missing from the file have their defaults.
PObject Whole(const PObject& task) {
    PObject whole(programs::DefaultSettings());
    whole.asMap().erase("pswd");
    for (const auto& [key, value] : task.asMap()) {
        whole[key] = value;
    }
    return whole;
}

}  // namespace

void ExportTasks(const std::string& path, bool with_passwords) {
    const bool to_output = path.empty() || path == "-";
    if (with_passwords && to_output) {
        throw Failure(FailureKind::kUsage,
                      "--with-passwords needs a file: passwords are never shown");
    }
    const PObject reply = GetTasks(with_passwords ? "secrets" : "export");
    const PObject::Array& tasks = reply["tasks"].asArray();
    const std::string text =
        programs::WriteConfiguration(tasks, programs::ListedShares(), with_passwords);
    if (to_output) {
        fputs(text.c_str(), stdout);
        return;
    }
    if (!base::ReplaceFile(path, text, with_passwords ? kSecretMode : kPlainMode)) {
        throw programs::SystemFailure("cannot write " + Printable(path), FailureKind::kLocal);
    }
    printf("%s in %s%s\n", programs::Count(tasks.size(), "task").c_str(), Printable(path).c_str(),
           with_passwords ? ", with their passwords: keep it safe" : "");
}

void ImportTasks(const std::string& path, bool replace, const std::string& password_file) {
    programs::Configuration file = ReadFileOf(path);
    for (PObject& task : file.tasks) {
        task = Whole(task);
    }
    Import import(std::move(file), replace, password_file);
    import.Check();
    import.MeetServers();
    import.GetPasswords();
    import.AddShares();
    import.Send();
}

}  // namespace zelctl
