#include "programs/zelctl/task/transfer.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <optional>

#include "ZEL/sync_obj.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/share/commands.h"
#include "programs/zelctl/task/file.h"
#include "programs/zelctl/task/options.h"
#include "programs/zelctl/task/view.h"

namespace zelctl {

namespace {

using programs::Printable;
using ZEL::PObject;

constexpr size_t kMaxFileBytes = size_t{16} << 20;  // a thousand times what thousand tasks need
constexpr size_t kFaultsShown = 20;
constexpr mode_t kSecretMode = 0600;
constexpr mode_t kPlainMode = 0644;

ExitCode GetTasks(bool secrets, PObject& reply) {
    PObject request;
    request["command"] = "task_list";
    if (secrets) {
        request["secrets"] = 1;
    }
    return AskDaemon(request, reply);
}

ExitCode ReadTasks(const std::string& path, std::vector<PObject>& tasks) {
    const auto text = base::ReadFile(path == "-" ? "/dev/stdin" : path, kMaxFileBytes);
    const std::string shown = Printable(path);
    if (!text) {
        return Fail(kLocal, "cannot read %s: %s", shown.c_str(), strerror(errno));
    }
    TaskFile file = ReadTaskFile(*text);
    for (size_t i = 0; i < file.faults.size() && i < kFaultsShown; ++i) {
        Fail(kUsage, "%s: %s", shown.c_str(), file.faults[i].c_str());
    }
    if (!file.faults.empty()) {
        return Fail(kUsage, "%s: %s; nothing was imported", shown.c_str(),
                    programs::Count(file.faults.size(), "fault").c_str());
    }
    tasks = std::move(file.tasks);
    return kOk;
}

ZEL::TaskInfo ToInfo(const PObject& task) {
    ZEL::SyncTask record;
    ZEL::PObj2SyncTask(task, record);
    return record.GetInfo();
}

ExitCode CheckPossible(const PObject& task) {
    const ZEL::TaskInfo info = ToInfo(task);
    ExitCode code = CheckTaskName(info.GetName());
    if (code != kOk) {
        return code;
    }
    const std::string name = Printable(info.GetName());
    if (!info.GetSchedule().Validate()) {
        return Fail(kUsage,
                    "task '%s': its schedule is not possible: the begin date must be one of the "
                    "calendar, and all runs of a day must fall on that day",
                    name.c_str());
    }
    code = CheckShares({info.GetShareList().begin(), info.GetShareList().end()});
    return code == kOk ? CheckTask(info) : Fail(code, "task '%s' is not possible", name.c_str());
}

/// The tasks of a file, on their way to the daemon.
class Import {
public:
    Import(std::vector<PObject> tasks, bool replace, std::string password_file)
        : tasks_(std::move(tasks)), replace_(replace), password_file_(std::move(password_file)) {}

    /// Looks at the tasks, and tells what is wrong with them, up to a screenful.
    ExitCode Check() {
        PObject reply;
        ExitCode code = GetTasks(false, reply);
        if (code != kOk) {
            return code;
        }
        for (PObject& task : reply["tasks"].asArray()) {
            const std::string name = static_cast<const PObject&>(task)["name"].asString();
            there_[name].swap(task);
        }
        size_t told = 0;
        for (const PObject& task : tasks_) {
            const ExitCode checked = CheckOne(task);
            code = code == kOk ? checked : code;
            told += checked == kOk ? 0 : 1;
            if (told == kFaultsShown) {
                break;
            }
        }
        return code == kOk ? code : Fail(code, "nothing was imported");
    }

    ExitCode GetPasswords() {
        for (PObject& task : tasks_) {
            const ExitCode code = GetPassword(task);
            if (code != kOk) {
                return code;
            }
        }
        return kOk;
    }

    ExitCode Send() {
        size_t sent = 0;
        for (PObject& task : tasks_) {
            const PObject& read = task;
            const std::string name = read["name"].asString();
            if (IsThere(name)) {
                task["task"] = name;
            }
            task["command"] = IsThere(name) ? "task_edit" : "task_add";
            PObject reply;
            const ExitCode code = AskDaemon(task, reply);
            if (code != kOk) {
                return Fail(code, "%zu of %zu tasks are imported; '%s' and those after it are not",
                            sent, tasks_.size(), Printable(name).c_str());
            }
            ++sent;
        }
        printf("%s imported.\n", programs::Count(sent, "task").c_str());
        return kOk;
    }

private:
    bool IsThere(const std::string& name) const { return there_.count(name) != 0; }

    ExitCode CheckOne(const PObject& task) const {
        const std::string name = task["name"].asString();
        if (IsThere(name) && !replace_) {
            return Fail(kLocal, "there is a task '%s' already: --replace makes it that of the file",
                        Printable(name).c_str());
        }
        return CheckPossible(task);
    }

    ExitCode GetPassword(PObject& task) {
        const PObject& read = task;
        if (read.hasMember("pswd")) {
            return kOk;
        }
        const auto before = there_.find(read["name"].asString());
        if (before != there_.end() && ServerOf(before->second) == ServerOf(read) &&
            before->second["user"].asString() == read["user"].asString()) {
            return kOk;  // the daemon has it, and for this very account
        }
        if (password_file_.empty() || !password_) {
            std::string error;
            password_ =
                programs::ReadNewPassword(password_file_,
                                          "Password of " + Printable(read["user"].asString()) +
                                              " on " + Printable(ServerOf(read)) + " (task '" +
                                              Printable(read["name"].asString()) + "'): ",
                                          error);
            if (!password_) {
                return Fail(kUsage, "%s; nothing was imported", error.c_str());
            }
        }
        task["pswd"] = *password_;
        return kOk;
    }

    std::vector<PObject> tasks_;
    bool replace_;
    std::string password_file_;
    std::optional<std::string> password_;   // the last one that was read
    std::map<std::string, PObject> there_;  // the daemon's tasks by name
};

// A task of the file that replaces one is whole: what it does not say has its default.
PObject Whole(const PObject& task) {
    PObject whole;
    ZEL::TaskInfo2PObj(ToInfo(task), whole);
    if (!task.hasMember("pswd")) {
        whole.asMap().erase("pswd");
    }
    whole["exclude"].asArray() = task["exclude"].asArray();
    return whole;
}

}  // namespace

ExitCode ExportTasks(const std::string& path, bool with_passwords) {
    const bool to_output = path.empty() || path == "-";
    if (with_passwords && to_output) {
        return Fail(kUsage, "--with-passwords needs a file: passwords are never shown");
    }
    PObject reply;
    const ExitCode code = GetTasks(with_passwords, reply);
    if (code != kOk) {
        return code;
    }
    const PObject::Array& tasks = static_cast<const PObject&>(reply)["tasks"].asArray();
    const std::string text = WriteTaskFile(tasks, with_passwords);
    if (to_output) {
        fputs(text.c_str(), stdout);
        return kOk;
    }
    if (!base::ReplaceFile(path, text, with_passwords ? kSecretMode : kPlainMode)) {
        return Fail(kLocal, "cannot write %s: %s", Printable(path).c_str(), strerror(errno));
    }
    printf("%s in %s%s\n", programs::Count(tasks.size(), "task").c_str(), Printable(path).c_str(),
           with_passwords ? ", with their passwords: keep it safe" : "");
    return kOk;
}

ExitCode ImportTasks(const std::string& path, bool replace, const std::string& password_file) {
    std::vector<PObject> tasks;
    ExitCode code = ReadTasks(path, tasks);
    if (code != kOk) {
        return code;
    }
    for (PObject& task : tasks) {
        task = Whole(task);
    }
    Import import(std::move(tasks), replace, password_file);
    code = import.Check();
    if (code == kOk) {
        code = import.GetPasswords();
    }
    return code == kOk ? import.Send() : code;
}

}  // namespace zelctl
