#include "programs/zelctl/task/transfer.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <optional>

#include "ZEL/pobject.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "programs/common/task_fields.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/share/commands.h"
#include "programs/zelctl/task/file.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;
using ZEL::PObject;

constexpr size_t kMaxFileBytes = size_t{16} << 20;  // a thousand times what thousand tasks need
constexpr size_t kFaultsShown = 20;
constexpr mode_t kSecretMode = 0600;
constexpr mode_t kPlainMode = 0644;

PObject GetTasks(bool secrets) {
    PObject request;
    request["command"] = "task_list";
    if (secrets) {
        request["secrets"] = 1;
    }
    return AskDaemon(request);
}

std::vector<PObject> ReadTasks(const std::string& path) {
    const auto text = base::ReadFile(path == "-" ? "/dev/stdin" : path, kMaxFileBytes);
    const std::string shown = Printable(path);
    if (!text) {
        throw programs::SystemFailure("cannot read " + shown, FailureKind::kLocal);
    }
    TaskFile file = ReadTaskFile(*text);
    for (size_t i = 0; i < file.faults.size() && i < kFaultsShown; ++i) {
        programs::Report("zelctl", shown + ": " + file.faults[i]);
    }
    if (!file.faults.empty()) {
        throw Failure(
            FailureKind::kUsage,
            shown + ": " + programs::Count(file.faults.size(), "fault") + "; nothing was imported");
    }
    return std::move(file.tasks);
}

void CheckPossible(const PObject& task) {
    try {
        CheckShares(programs::TextsOf(task["share_list"]));
    } catch (const Failure& failure) {
        programs::Report("zelctl", failure.what());
        throw Failure(failure.Kind(),
                      "task '" + Printable(task["name"].asString()) + "' is not possible");
    }
}

/// The tasks of a file, on their way to the daemon.
class Import {
public:
    Import(std::vector<PObject> tasks, bool replace, std::string password_file)
        : tasks_(std::move(tasks)), replace_(replace), password_file_(std::move(password_file)) {}

    /// Looks at the tasks, and tells what is wrong with them, up to a screenful.
    void Check() {
        PObject reply = GetTasks(false);
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
        CheckPossible(task);
    }

    void GetPassword(PObject& task) {
        const PObject& read = task;
        if (read.hasMember("pswd")) {
            return;
        }
        const auto before = there_.find(read["name"].asString());
        if (before != there_.end() &&
            programs::ServerOf(before->second) == programs::ServerOf(read) &&
            before->second["user"].asString() == read["user"].asString()) {
            return;  // the daemon has it, and for this very account
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
    bool replace_;
    std::string password_file_;
    std::optional<std::string> password_;   // the last one that was read
    std::map<std::string, PObject> there_;  // the daemon's tasks by name
};

// A task of the file that replaces one is whole: what it does not say has its default.
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
    const PObject reply = GetTasks(with_passwords);
    const PObject::Array& tasks = reply["tasks"].asArray();
    const std::string text = WriteTaskFile(tasks, with_passwords);
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
    std::vector<PObject> tasks = ReadTasks(path);
    for (PObject& task : tasks) {
        task = Whole(task);
    }
    Import import(std::move(tasks), replace, password_file);
    import.Check();
    import.GetPasswords();
    import.Send();
}

}  // namespace zelctl
