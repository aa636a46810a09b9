#include "platform/tarqrsync/run.h"

#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <mutex>
#include <set>

#include "base/background_priority.h"
#include "base/child_process.h"
#include "base/config_file.h"
#include "base/random_digits.h"
#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "platform/tarqrsync/answer_file.h"
#include "platform/tarqrsync/message_keeper.h"
#include "tarq/root_path.h"
#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

namespace {

using base::ChildResult;
using base::ChildSetup;

constexpr char kLogPath[] = "/var/log/tarqrsync.log";
constexpr off_t kMaxLogBytes = off_t{1024} * 1024;
// A command's rsync writes the answer and, to a log that was below its limit before, a few lines.
constexpr uint64_t kMaxCommandFileBytes = kMaxAnswerBytes;

// rsync's own codes: a file cannot be written; a child was killed by a signal; a child was reaped
// by somebody else.
constexpr int kStatusFileIo = 11;
constexpr int kStatusKilled = 16;
constexpr int kStatusLostChild = 21;

using Version = std::array<int, 3>;
constexpr Version kOldestRsync = {3, 2, 1};

// The log's path when rsync can write there, else empty: a run without its log is better than none.
std::string PrepareLog() {
    const std::string path = RootPath(kLogPath);
    struct stat info;
    if (stat(path.c_str(), &info) == 0 && info.st_size >= kMaxLogBytes) {
        rename(path.c_str(), (path + ".1").c_str());
    }
    const base::UniqueFd log(open(
        path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0640));
    const bool usable =
        log && fstat(log.Get(), &info) == 0 && S_ISREG(info.st_mode) && info.st_size < kMaxLogBytes;
    return usable ? path : "";
}

std::string RandomId() {
    std::string id = base::RandomDigits();
    if (id.empty()) {
        throw PrivateFileError("no random numbers for a run");
    }
    return id;
}

// The number in "rsync  version 3.2.7  protocol version 31"; empty when the program does not say.
std::string AskVersion(const ChildSetup& used) {
    ChildSetup setup;
    setup.program = used.program;
    setup.arguments = {used.program, "--version"};
    setup.environment = used.environment;
    std::string text;
    base::RunChild(
        setup, nullptr, [&text](const char* bytes, size_t size) { text.append(bytes, size); },
        nullptr);
    const std::string head = "rsync  version ";
    if (text.compare(0, head.size(), head) != 0) {
        return "";
    }
    return text.substr(head.size(), text.find(' ', head.size()) - head.size());
}

bool IsTooOld(const std::string& text) {
    Version version = {};
    const char* position = text.data();
    const char* const end = text.data() + text.size();
    for (int& part : version) {
        const auto [rest, error] = std::from_chars(position, end, part);
        if (error != std::errc()) {
            return false;
        }
        position = rest < end && *rest == '.' ? rest + 1 : rest;
    }
    return version < kOldestRsync;
}

bool IsMissing(const std::string& path) {
    struct stat info;
    return lstat(path.c_str(), &info) != 0 && (errno == ENOENT || errno == ENOTDIR);
}

std::string CommandText(const std::string& session, const std::list<std::string>& lines) {
    std::string text = "session=\"" + session + "\"\n";
    for (const std::string& line : lines) {
        text += line + "\n";
    }
    return text;
}

// True when the process `pid` is known to be in a timed sleep.
bool IsInTimedSleep(pid_t pid) {
    const auto text = base::ReadFile("/proc/" + std::to_string(pid) + "/syscall");
    long number = -1;  // of the system call; no number when the process runs
    if (!text) {
        return false;
    }
    std::from_chars(text->data(), text->data() + text->size(), number);
#ifdef SYS_clock_nanosleep_time64
    if (number == SYS_clock_nanosleep_time64) {
        return true;
    }
#endif
    return number == SYS_clock_nanosleep || number == SYS_nanosleep;
}

std::string SecondsText(int seconds) {
    return seconds == 60    ? "a minute"
           : seconds == 120 ? "two minutes"
                            : std::to_string(seconds) + " seconds";
}

// rsync receives in a child, which renames the answer into place once it has checked it. When then
// the connection's last words are written, the parent tells the child to go and looks after it
// every 20 ms: half of what a command costs. The watch sees the answer, and that the parent sleeps,
// which it does at no other time after the answer, and lets the run end there. Where it cannot
// see them the run ends by itself.
class AnswerWatch {
public:
    AnswerWatch(const std::string& folder, const std::string& answer_file)
        : answer_file_(answer_file), notify_(inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
        if (notify_ && inotify_add_watch(notify_.Get(), folder.c_str(), IN_MOVED_TO) < 0) {
            notify_.Reset();
        }
    }

    base::EarlyEnd End() const {
        return {notify_.Get(),
                [this](pid_t rsync) { return !IsMissing(answer_file_) && IsInTimedSleep(rsync); }};
    }

private:
    std::string answer_file_;
    base::UniqueFd notify_;
};

// Servers of earlier versions, which refuse runs that keep versions, by name: each is asked once,
// and the log speaks of it once.
class ServersWithoutVersions {
public:
    bool Has(const std::string& server) {
        const std::lock_guard<std::mutex> guard(mutex_);
        return servers_.count(server) != 0;
    }
    void Add(const std::string& server) {
        const std::lock_guard<std::mutex> guard(mutex_);
        if (servers_.insert(server).second) {
            syslog(LOG_NOTICE,
                   "tarqrsync: %s is of an earlier version and keeps no versions of what is "
                   "replaced or deleted: copying without until it is upgraded",
                   server.c_str());
        }
    }
    void Remove(const std::string& server) {
        const std::lock_guard<std::mutex> guard(mutex_);
        servers_.erase(server);
    }

private:
    std::mutex mutex_;
    std::set<std::string> servers_;
};
ServersWithoutVersions g_servers_without_versions;

// An earlier server names the word of letters, in which "b" for --backup comes first.
constexpr char kBackupRefused[] = "Refused: rsync's argument '-b";
constexpr char kRefused[] = "Refused: ";

}  // namespace

int Run::Execute(const std::function<bool()>& cancelled) {
    try {
        outcome_.status = Attempt(cancelled);
    } catch (const PrivateFileError& error) {
        outcome_.status = Fail(kStatusFileIo, error.what());
    } catch (const base::ConfigError& error) {
        outcome_.status = Fail(STATUS_SYNTAX, error.what());
    } catch (const ServersError& error) {
        outcome_.status = Fail(STATUS_SYNTAX, error.what());
    }
    return outcome_.status;
}

int Run::Attempt(const std::function<bool()>& cancelled) {
    const std::string refusal = RefusalOf(settings_);
    if (!refusal.empty()) {
        const bool lacks_account = settings_.user.empty() && settings_.account_required;
        return Fail(lacks_account ? STATUS_AUTHENTICATION : STATUS_SYNTAX, refusal);
    }
    if (const std::string bad_path = RefusalOf(options_); !bad_path.empty()) {
        return Fail(STATUS_SYNTAX, bad_path);
    }
    config_ = base::ReadRsyncConfig(RootPath(base::kRsyncConfigPath));
    if (settings_.is_command) {
        config_.answer_seconds =
            std::max(config_.answer_seconds, static_cast<int>(options_.answer_seconds));
    }
    route_ = RouteOf(settings_, options_, config_);
    if (settings_.debug_log) {
        log_file_ = PrepareLog();
    }
    return settings_.is_command ? RunCommand(cancelled) : RunCopy(cancelled);
}

int Run::RunCommand(const std::function<bool()>& cancelled) {
    const std::string session = RandomId();
    const std::string text = CommandText(session, settings_.command);
    if (text.size() > kMaxCommandBytes) {
        return Fail(STATUS_COMMAND_TOO_LONG,
                    "the command has " + std::to_string(text.size()) +
                        " bytes and rsync carries no more than " +
                        std::to_string(kMaxCommandBytes) +
                        ": it was not sent; name fewer or shorter shares in one command");
    }
    const RunOptions no_options;
    OutputParser parser(no_options, /*listing=*/false);
    const std::string answer_file = folder_.Path("answer");
    const InvocationContext context = {settings_, route_, config_,  no_options,
                                       false,     false,  log_file_};
    const Invocation invocation =
        CommandInvocation(context, folder_.Write("command", text), session, answer_file);
    const AnswerWatch watch(folder_.Path(""), answer_file);
    ChildLimits limits = {kMaxCommandFileBytes, {}};
    // With ssh the last words are written to it, and not yet to the connection.
    if (route_.transport != Transport::DAEMON_OVER_SSH) {
        limits.early_end = watch.End();
    }
    const int status = RunRsync(cancelled, invocation, &parser, limits);
    // rsync tells on its standard output what it did not take for an answer, a link for example.
    messages_ += parser.OtherText();
    return status == STATUS_DONE ? TakeAnswer(answer_file) : status;
}

int Run::TakeAnswer(const std::string& answer_file) {
    const std::string& host = route_.name;
    std::string text;
    Answer answer;
    if (!ReadAnswerFile(answer_file, &text)) {
        return Fail(STATUS_PROTOCOL_STREAM,
                    host + " answered with something that is no file, or one larger than " +
                        std::to_string(kMaxAnswerBytes) + " bytes");
    }
    if (!ParseAnswer(text, &answer)) {
        return Fail(STATUS_PROTOCOL_STREAM,
                    "the answer of " + host + " does not begin with a status");
    }
    const std::string outfile = OutfileOf(settings_.command);
    if (!outfile.empty() && !WriteOutfile(outfile, std::string(answer.content))) {
        return Fail(kStatusFileIo, "the answer of " + host + " cannot be written to " + outfile +
                                       ": " + strerror(errno));
    }
    if (answer.status != STATUS_DONE) {
        Fail(answer.status,
             host + " answered the command with status " + std::to_string(answer.status));
    }
    return answer.status;
}

int Run::RunCopy(const std::function<bool()>& cancelled) {
    if (!settings_.list_only && !(settings_.pull && options_.dry_run) &&
        options_.source_folder < 0 && IsMissing(settings_.source)) {
        return Fail(STATUS_FILE_SELECT, (settings_.pull ? "the folder " : "the source ") +
                                            settings_.source + " does not exist");
    }
    InvocationContext context = {settings_,     route_,        config_,  options_,
                                 settings_.acl, settings_.acl, log_file_};
    const bool may_keep = options_.keep_versions && !options_.dry_run && !settings_.list_only &&
                          route_.transport != Transport::DIRECTORY_OVER_SSH;
    // A run that is a whole push is what it is, or fails.
    const bool starts = !options_.start.empty();
    bool keeps = may_keep && (starts || !g_servers_without_versions.Has(route_.name));
    bool turned = starts;  // between the two once: a server that refuses both has another reason
    const std::string start = starts ? CommandText(RandomId(), options_.start) : "";
    if (start.size() > kMaxCommandBytes) {
        return Fail(STATUS_COMMAND_TOO_LONG, "the start has " + std::to_string(start.size()) +
                                                 " bytes and rsync carries no more than " +
                                                 std::to_string(kMaxCommandBytes));
    }
    while (true) {
        OutputParser parser(options_, settings_.list_only);
        PrivateFolder files;
        context.versions = keeps ? RandomId() : "";
        context.start_file = starts ? files.Write("start", start) : "";
        const int status = RunRsync(cancelled, CopyInvocation(context, &files), &parser, {});
        parser.Finish();
        parser.FillReport(&outcome_);
        outcome_.begun = parser.Begun();
        if (may_keep && !turned && status != STATUS_DONE &&
            outcome_.cause != RunCause::NO_LISTED_CHANGES &&
            messages_.find(keeps ? kBackupRefused : kRefused) != std::string::npos) {
            turned = true;
            keeps = !keeps;
            if (keeps) {
                g_servers_without_versions.Remove(route_.name);  // it has been upgraded
            } else {
                g_servers_without_versions.Add(route_.name);
            }
            continue;
        }
        const RefusedAttributes refused = FindRefusedAttributes(Facts(status));
        const bool less = (context.acls && refused.acls) || (context.xattrs && refused.xattrs);
        if (status == STATUS_DONE || !less || starts) {
            return status;
        }
        context.acls = context.acls && !refused.acls;
        context.xattrs = context.xattrs && !refused.xattrs;
        syslog(LOG_NOTICE, "tarqrsync: %s cannot keep %s of %s: copying without",
               settings_.pull ? "this machine" : route_.name.c_str(),
               refused.acls ? "the access control lists" : "the extended attributes",
               settings_.source.c_str());
    }
}

// Runs one rsync; after a failure the explanation is there.
int Run::RunRsync(const std::function<bool()>& cancelled, const Invocation& invocation,
                  OutputParser* parser, const ChildLimits& limits) {
    outcome_.explanation.clear();
    outcome_.details.clear();
    outcome_.cause = RunCause::NONE;
    outcome_.incomplete.clear();
    messages_.clear();
    ChildSetup setup;
    setup.program = base::FindProgram(config_.rsync, SearchPath());
    setup.arguments = invocation.arguments;
    setup.arguments.insert(setup.arguments.begin(), config_.rsync);
    setup.environment = invocation.environment;
    setup.input = invocation.input;
    setup.max_file_bytes = limits.max_file_bytes;
    setup.folder = settings_.is_command ? -1 : options_.source_folder;
    if (setup.program.empty()) {
        return Fail(STATUS_RSYNC_MISSING, "the program " + config_.rsync + " is not installed");
    }

    MessageKeeper keeper;
    RunWatch watch(PatienceOfRun());
    RunWatch::Fault fault = RunWatch::Fault::NONE;
    setup.on_start = [&](pid_t rsync) {
        watch.Started(rsync);
        if (options_.background) {
            base::GiveWay(rsync);
        }
    };
    const ChildResult result = base::RunChild(
        setup,
        [&] {
            // What a server says before its answer does not extend a command's time.
            fault = watch.Look(!settings_.is_command && parser->Begun());
            parser->Tick(watch.SecondsStill());
            return fault != RunWatch::Fault::NONE || (cancelled && cancelled());
        },
        [&](const char* bytes, size_t size) {
            watch.Spoke();
            parser->Feed({bytes, size});
        },
        [&](const char* bytes, size_t size) {
            watch.Spoke();
            keeper.Feed({bytes, size});
        },
        limits.early_end);
    messages_ = keeper.Text();
    if (result.start_error != 0) {
        return Fail(STATUS_RSYNC_MISSING, "the program " + setup.program + " cannot be started: " +
                                              strerror(result.start_error));
    }
    if (fault != RunWatch::Fault::NONE) {
        return FailByWatch(fault);
    }
    if (result.cancelled) {
        return Fail(STATUS_CANCELLED, "the run was cancelled");
    }
    if (result.ended_early) {
        return STATUS_DONE;
    }
    if (result.wait_status == -1) {
        return Fail(kStatusLostChild,
                    "rsync ended and its exit code went to another part of this program");
    }
    if (WIFSIGNALED(result.wait_status)) {
        return Fail(kStatusKilled,
                    "rsync was killed by signal " + std::to_string(WTERMSIG(result.wait_status)));
    }
    const int exit_code = WEXITSTATUS(result.wait_status);
    if (exit_code == STATUS_DONE) {
        return STATUS_DONE;
    }
    if (exit_code == STATUS_SYNTAX && messages_.find("unknown option") != std::string::npos) {
        const std::string version = AskVersion(setup);
        if (IsTooOld(version)) {
            return Fail(STATUS_SYNTAX, setup.program + " is rsync " + version +
                                           ", which is too old: version 3.2.1 or later is needed");
        }
    }
    const Verdict verdict = Judge(Facts(exit_code));
    outcome_.cause = verdict.cause;
    if (verdict.cause == RunCause::UNREADABLE_SOURCE || verdict.cause == RunCause::BUSY_SOURCE) {
        outcome_.incomplete = IncompleteEntries(Facts(exit_code), &outcome_.all_incomplete);
    }
    return Fail(verdict.status, verdict.first_line);
}

Patience Run::PatienceOfRun() const {
    using std::chrono::seconds;
    // A listing says nothing before all of it is there.
    const bool begins = settings_.is_command || !settings_.list_only;
    return {seconds(ConnectTimeout(settings_)), seconds(begins ? config_.answer_seconds : 0),
            seconds(config_.dead_seconds)};
}

int Run::FailByWatch(RunWatch::Fault fault) {
    const std::string& host = route_.name;
    const std::string patience = SecondsText(config_.answer_seconds);
    switch (fault) {
        case RunWatch::Fault::SILENT:
            return Fail(STATUS_TIMEOUT, host + " accepted the connection and said nothing for " +
                                            patience + ": is an rsync daemon what listens there?");
        case RunWatch::Fault::DEAD:
            return Fail(STATUS_TIMEOUT, "the connection to " + host +
                                            " is dead: nothing that was sent has been answered "
                                            "for " +
                                            SecondsText(config_.dead_seconds));
        default:
            return Fail(STATUS_TIMEOUT,
                        host +
                            (settings_.is_command ? " did not answer the command within "
                                                  : " did not let the copy begin within ") +
                            patience);
    }
}

int Run::Fail(int status, const std::string& first_line) {
    outcome_.explanation = first_line;
    outcome_.details = messages_;
    while (!outcome_.details.empty() && outcome_.details.back() == '\n') {
        outcome_.details.pop_back();
    }
    return status;
}

}  // namespace Backup
}  // namespace TARQ
