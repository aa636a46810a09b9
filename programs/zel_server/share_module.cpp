#include "programs/zel_server/share_module.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <map>
#include <set>
#include <sstream>
#include <string_view>
#include <vector>

#include "base/random_digits.h"
#include "base/replace_file.h"
#include "base/text.h"
#include "base/whole_file.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/rsyncd_config.h"
#include "programs/zel_server/storage.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

namespace fs = std::filesystem;

constexpr size_t kMaxFile = 65536;
constexpr time_t kSilentAfter = 600;
constexpr char kSuffix[] = ".conf";
constexpr size_t kMaxPastModules = 8;  // of an account
// Prefix of random module names. Neither a share's name nor its file begins like this.
constexpr char kReadPrefix[] = ".";
constexpr char kReadFilePrefix[] = "@";

struct AccessWord {
    Access access;
    const char* word;
};
constexpr AccessWord kAccessWords[] = {
    {Access::kWrite, "write"}, {Access::kCompare, "compare"}, {Access::kRead, "read"}};

const char* WordOf(Access access) {
    for (const AccessWord& entry : kAccessWords) {
        if (entry.access == access) {
            return entry.word;
        }
    }
    abort();
}

bool IsRoot() {
    return geteuid() == 0;
}

// ---- Files ----

std::string InFolder(const std::string& name) {
    return OpenModules() + "/" + name;
}

std::string FileOfShare(const std::string& share) {
    return InFolder(ModuleKey(share) + kSuffix);
}

bool EndsWith(const std::string& text, const std::string& end) {
    return text.size() > end.size() && text.compare(text.size() - end.size(), end.size(), end) == 0;
}

// Paths of the files of all open modules; `error`: why these are not all.
std::vector<std::string> ModuleFiles(std::error_code& error) {
    std::vector<std::string> files;
    for (fs::directory_iterator entry(OpenModules(), error), end; !error && entry != end;
         entry.increment(error)) {
        if (EndsWith(entry->path(), kSuffix)) {
            files.push_back(entry->path());
        }
    }
    return files;
}

std::vector<std::string> ModuleFiles() {
    std::error_code ignored;
    return ModuleFiles(ignored);
}

void SetTimeToNow(const std::string& file) {
    utimensat(AT_FDCWD, file.c_str(), nullptr, 0);
}

// A file time in the future does not count as recent activity either: the clock was set back.
bool IsSilent(const std::string& file) {
    struct stat info = {};
    return stat(file.c_str(), &info) != 0 ||
           std::abs(static_cast<long long>(time(nullptr)) - info.st_mtime) > kSilentAfter;
}

// ---- Transfers: each has a file beside the module's, with the process number in its name ----

// When the process was started, in the kernel's ticks; empty when there is no such process.
// Together with the process number this identifies a process even after the number is reused.
std::string BeginningOf(const std::string& process) {
    const auto text = base::ReadFile("/proc/" + process + "/stat", kMaxFile);
    // The name, in parentheses, may contain anything. The start time is word 20 after it.
    constexpr int kWord = 20;
    if (!text || text->rfind(')') == std::string::npos) {
        return "";
    }
    std::istringstream words(text->substr(text->rfind(')') + 1));
    std::string word;
    for (int i = 0; i < kWord; ++i) {
        words >> word;
    }
    return word;
}

std::string TransferFile(const std::string& module_file, const std::string& process) {
    return module_file + "." + process;
}

// The module file's part of a transfer file's path; empty for any other path.
std::string ModuleOfTransfer(const std::string& file) {
    const size_t dot = file.rfind('.');
    const std::string module = file.substr(0, dot);
    return base::ParseNumber(file.substr(dot + 1), UINT32_MAX) && EndsWith(module, kSuffix) ? module
                                                                                            : "";
}

struct RunningTransfer {
    pid_t process;
    std::string module_file;
    std::string id;  // of its own folders; empty: it writes nothing
};

// All running transfers. The files of ended processes are removed. A file has the start time of the
// process, and in a second line the ID.
std::vector<RunningTransfer> RunningTransfers() {
    std::vector<RunningTransfer> running;
    std::error_code error;
    for (fs::directory_iterator entry(OpenModules(), error), end; !error && entry != end;
         entry.increment(error)) {
        const std::string file = entry->path();
        const std::string module = ModuleOfTransfer(file);
        if (module.empty()) {
            continue;
        }
        const std::string process = file.substr(module.size() + 1);
        const std::string beginning = BeginningOf(process);
        const std::string text = base::ReadFile(file, kMaxFile).value_or("");
        const size_t line = std::min(text.find('\n'), text.size());
        if (!beginning.empty() && text.substr(0, line) == beginning) {
            running.push_back({static_cast<pid_t>(*base::ParseNumber(process, UINT32_MAX)), module,
                               text.substr(std::min(line + 1, text.size()))});
        } else {
            unlink(file.c_str());
        }
    }
    return running;
}

// The files of modules with a running transfer.
std::set<std::string> BusyModules() {
    std::set<std::string> busy;
    for (const RunningTransfer& transfer : RunningTransfers()) {
        busy.insert(transfer.module_file);
    }
    return busy;
}

// ---- A module's text ----

constexpr char kShareLine[] = "# share = ";
constexpr char kAccountLine[] = "# account = ";
constexpr char kClientLine[] = "# client = ";
constexpr char kAccessLine[] = "# access = ";
constexpr char kPastLine[] = "# past = ";
constexpr char kProcessLine[] = "# process = ";
constexpr char kMarkLine[] = "# mark = ";

std::string TextOf(const ServerConfig& config, const OpenModule& module, const std::string& path) {
    std::ostringstream text;
    text << kShareLine << module.share << "\n"
         << kAccountLine << module.account << "\n"
         << kClientLine << module.client << "\n"
         << kAccessLine << WordOf(module.access) << "\n"
         << kPastLine << (module.past ? "yes" : "no") << "\n";
    if (!module.process.empty()) {
        text << kProcessLine << module.process << "\n" << kMarkLine << module.mark << "\n";
        return text.str();
    }
    text << "[" << module.name << "]\n"
         << "    path = " << path << "\n"
         << "    list = no\n"
         // rsync refuses every push into a read-only module, even a dry run. What admit-transfer
         // takes for a dry run is one: it looks at the same option letter (n) as rsync itself.
         << "    read only = " << (module.access == Access::kRead ? "yes" : "no") << "\n"
         << "    auth users = " << module.account << "\n"
         << "    secrets file = " << SecretsFile() << "\n"
         << LinesOfCopy(config, KeepsAttributes(path));
    return text.str();
}

// The rest of the line of `text` that starts with `beginning`.
std::string Behind(const std::string& beginning, const std::string& text) {
    const size_t found = text.find("\n" + beginning);
    const size_t at = found == std::string::npos ? text.size() : found + 1 + beginning.size();
    return text.substr(at, text.find('\n', at) - at);
}

std::optional<OpenModule> ReadModule(const std::string& file) {
    const auto content = base::ReadFile(file, kMaxFile);
    if (!content) {
        return std::nullopt;
    }
    const std::string text = "\n" + *content;
    OpenModule module;
    module.share = Behind(kShareLine, text);
    module.account = Behind(kAccountLine, text);
    module.client = Behind(kClientLine, text);
    module.name = Behind("[", text);
    module.past = Behind(kPastLine, text) == "yes";
    module.process = Behind(kProcessLine, text);
    module.mark = Behind(kMarkLine, text);
    const bool is_named = EndsWith(module.name, "]");
    if (is_named) {
        module.name.pop_back();
    }
    const std::string word = Behind(kAccessLine, text);
    for (const AccessWord& entry : kAccessWords) {
        if (entry.word == word && IsAccountName(module.account) &&
            is_named == module.process.empty()) {
            module.access = entry.access;
            return module;
        }
    }
    return std::nullopt;
}

bool WriteModule(const ServerConfig& config, const std::string& file, const OpenModule& module,
                 const std::string& path) {
    return MakeInAnswers(OpenModules()) &&
           base::ReplaceFile(file, TextOf(config, module, path), 0600);  // its time is now
}

std::string FileOfModule(const OpenModule& module) {
    return module.access == Access::kWrite
               ? FileOfShare(module.share)
               : InFolder(kReadFilePrefix + module.name.substr(1) + kSuffix);
}

bool IsRandomName(const std::string& name) {
    return name.compare(0, 1, kReadPrefix) == 0 &&
           base::AreRandomDigits(std::string_view(name).substr(1));
}

// If the module was open for a push, the push is recorded as ended but incomplete.
void Close(const std::string& file, const std::optional<OpenModule>& module) {
    unlink(file.c_str());
    if (module && !module->process.empty()) {
        unlink(LinkOfPush(module->process).c_str());
    }
    ShareState state;
    if (module && module->access == Access::kWrite &&
        ReadShare(module->share, state) == ReadResult::kRead && !state.running_id.empty()) {
        EndPush(module->share, state, false);
    }
}

}  // namespace

bool MakeShareFolder(const ServerConfig& config, const std::string& path) {
    if (mkdir(path.c_str(), 0700) != 0) {
        struct stat info = {};
        return errno == EEXIST && lstat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
    }
    if (!IsRoot()) {
        return true;
    }
    const auto owner = OwnerOfCopies(config);
    return owner && chown(path.c_str(), owner->uid, owner->gid) == 0;
}

std::optional<std::string> TextOfModules() {
    std::string text;
    std::error_code error;
    for (const std::string& file : ModuleFiles(error)) {
        const auto module = base::ReadFile(file, kMaxFile);
        if (!module && errno != ENOENT) {  // else it was closed meanwhile
            return std::nullopt;
        }
        text += module.value_or("");
    }
    errno = error.value();
    return !error || error == std::errc::no_such_file_or_directory ? std::optional(text)
                                                                   : std::nullopt;
}

bool OpenForWriting(const ServerConfig& config, const std::string& share, const ShareState& state) {
    return WriteModule(config, FileOfShare(share),
                       {state.module, Access::kWrite, share, state.account, state.running_id},
                       state.path);
}

bool OpenForConnection(const ServerConfig& config, const std::string& share,
                       const ShareState& state, const std::string& process,
                       const std::string& mark) {
    OpenModule module = {"", Access::kWrite, share, state.account, state.running_id};
    module.process = process;
    module.mark = mark;
    return WriteModule(config, FileOfShare(share), module, state.path) &&
           BeginTransferIn(module, process, "") && MakeInAnswers(PushLinks()) &&
           symlink(state.path.c_str(), LinkOfPush(process).c_str()) == 0;
}

std::optional<OpenModule> FindModuleOfTransfer(const std::string& process) {
    for (const RunningTransfer& transfer : RunningTransfers()) {
        if (std::to_string(transfer.process) == process) {
            return ReadModule(transfer.module_file);
        }
    }
    return std::nullopt;
}

std::optional<OpenModule> FindPushOf(const std::string& process) {
    const auto module = FindModuleOfTransfer(process);
    return module && module->process == process ? module : std::nullopt;
}

std::optional<OpenModule> FindPushInto(const std::string& share) {
    const std::string file = FileOfShare(share);
    const auto module = ReadModule(file);
    const bool runs = module && module->share == share && !module->process.empty() &&
                      BusyModules().count(file) != 0;
    return runs ? module : std::nullopt;
}

std::string LinkOfPush(const std::string& process) {
    return PushLinks() + "/" + process;
}

std::optional<std::string> OpenForReading(const ServerConfig& config, const std::string& share,
                                          const ShareState& state, const std::string& client,
                                          Access access) {
    for (const std::string& file : ModuleFiles()) {
        const auto open = ReadModule(file);
        if (open && open->access == access && open->share == share &&
            open->account == state.account && !open->past) {
            SetTimeToNow(file);
            return open->name;
        }
    }
    const OpenModule module = {NewModuleName(), access, share, state.account, client};
    return !module.name.empty() && WriteModule(config, FileOfModule(module), module, state.path)
               ? std::optional<std::string>(module.name)
               : std::nullopt;
}

bool OpenPast(const ServerConfig& config, const std::string& share, const ShareState& state,
              const std::string& client, const std::string& name, const std::string& tree) {
    std::vector<std::pair<fs::file_time_type, std::string>> idle;
    const std::set<std::string> busy = BusyModules();
    for (const std::string& file : ModuleFiles()) {
        const auto open = ReadModule(file);
        std::error_code gone;
        if (open && open->past && open->account == state.account && busy.count(file) == 0) {
            idle.emplace_back(fs::last_write_time(file, gone), file);
        }
    }
    std::sort(idle.begin(), idle.end());
    for (size_t i = 0; i + kMaxPastModules <= idle.size(); ++i) {
        unlink(idle[i].second.c_str());
    }
    const OpenModule module = {name, Access::kRead, share, state.account, client, true};
    return WriteModule(config, FileOfModule(module), module, tree);
}

std::string NewModuleName() {
    const std::string digits = base::RandomDigits();
    return digits.empty() ? "" : kReadPrefix + digits;
}

void ClosePast(const std::string& name, const std::string& account) {
    const auto module = FindModule(name);
    if (module && module->past && module->account == account) {
        unlink(FileOfModule(*module).c_str());
    }
}

std::optional<OpenModule> FindModule(const std::string& name) {
    const std::string share = ShareOfModule(name);
    std::optional<OpenModule> module;
    if (IsRandomName(name)) {
        module = ReadModule(InFolder(kReadFilePrefix + name.substr(1) + kSuffix));
    } else if (IsShareName(share)) {
        module = ReadModule(FileOfShare(share));
    }
    return module && module->process.empty() && module->name == name ? module : std::nullopt;
}

bool IsBeingPushed(const std::string& share) {
    const std::string file = FileOfShare(share);
    const auto module = ReadModule(file);
    return module && module->share == share && (!IsSilent(file) || BusyModules().count(file) != 0);
}

void KeepOpen(const std::string& share, const std::string& client, const std::string& account) {
    const std::string file = FileOfShare(share);
    const auto module = ReadModule(file);
    if (module && module->share == share && module->client == client &&
        module->account == account) {
        SetTimeToNow(file);
    }
}

void CloseShare(const std::string& share, bool all) {
    unlink(FileOfShare(share).c_str());
    for (const std::string& file : all ? ModuleFiles() : std::vector<std::string>()) {
        const auto module = ReadModule(file);
        if (module && module->share == share) {
            unlink(file.c_str());
        }
    }
}

void CloseAccount(const std::string& account) {
    for (const std::string& file : ModuleFiles()) {
        const auto module = ReadModule(file);
        if (module && module->account == account) {
            Close(file, module);
        }
    }
}

void CloseSilentModules() {
    const std::set<std::string> busy = BusyModules();
    for (const std::string& file : ModuleFiles()) {
        if (busy.count(file) != 0) {
            SetTimeToNow(file);  // the ten minutes start when the transfer ends, however it ends
            continue;
        }
        if (!IsSilent(file)) {
            continue;
        }
        Close(file, ReadModule(file));
    }
}

bool BeginTransferIn(const OpenModule& module, const std::string& process, const std::string& id) {
    const std::string file = FileOfModule(module);
    const std::string beginning = BeginningOf(process);
    if (beginning.empty() ||
        !base::ReplaceFile(TransferFile(file, process), beginning + "\n" + id, 0600)) {
        return false;
    }
    SetTimeToNow(file);
    return true;
}

void EndTransferIn(const OpenModule& module, const std::string& process) {
    const std::string file = FileOfModule(module);
    SetTimeToNow(file);
    unlink(TransferFile(file, process).c_str());
}

bool EndWritingInto(const std::string& share, const std::string& process) {
    return unlink(TransferFile(FileOfShare(share), process).c_str()) == 0;
}

std::map<std::string, pid_t> TransfersInto(const std::string& share) {
    std::map<std::string, pid_t> transfers;
    for (const RunningTransfer& transfer : RunningTransfers()) {
        if (transfer.module_file == FileOfShare(share) && !transfer.id.empty()) {
            transfers.emplace(transfer.id, transfer.process);
        }
    }
    return transfers;
}

}  // namespace zel_server
