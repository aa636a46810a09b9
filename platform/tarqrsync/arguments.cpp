#include "platform/tarqrsync/arguments.h"

#include <unistd.h>

#include <algorithm>
#include <cstdlib>

#include "platform/tarqrsync/answer_file.h"
#include "platform/tarqrsync/helper_program.h"
#include "platform/tarqrsync/host_keys.h"
#include "tarq/root_path.h"
#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr char kLoopback[] = "127.0.0.1";
constexpr char kDefaultPath[] = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";

// Seconds that a connection may take to come up: a server that has not answered by then is not
// there, however patient the caller is with a slow copy.
constexpr int kConnectTimeout = 60;
// Seconds after which ssh asks a silent server whether it is still there, and how often before it
// gives up. A slow line that is full may take a while to carry the answer.
constexpr int kSshAliveInterval = 30;
constexpr int kSshAliveCount = 4;

// Rules that are longer together go to a file: a program's arguments have a limit.
constexpr size_t kMaxRuleBytes = size_t{32} * 1024;

using Words = std::vector<std::string>;

void Append(Words* words, const Words& more) {
    words->insert(words->end(), more.begin(), more.end());
}

bool IsNumericIPv6(const std::string& host) {
    return host.find(':') != std::string::npos;
}

std::string HostForRsync(const std::string& host) {
    return IsNumericIPv6(host) ? "[" + host + "]" : host;
}

std::string Quoted(const std::string& word, const std::string& escaped_quote) {
    std::string result = "'";
    for (const char c : word) {
        result += c == '\'' ? escaped_quote : std::string(1, c);
    }
    return result + "'";
}

std::string Joined(const Words& words, const std::string& escaped_quote) {
    std::string result;
    for (const std::string& word : words) {
        result += (result.empty() ? "" : " ") + Quoted(word, escaped_quote);
    }
    return result;
}

std::string DoubledPercent(const std::string& text) {
    std::string result;
    for (const char c : text) {
        result += c == '%' ? "%%" : std::string(1, c);
    }
    return result;
}

// The ssh command line up to the host. The configured words come first, as the first value that ssh
// meets is the one that holds.
Words SshWords(const InvocationContext& context) {
    const Settings& settings = context.settings;
    Words words = {context.config.ssh};
    Append(&words, context.config.ssh_options);
    if (context.route.port != 0) {
        Append(&words, {"-p", std::to_string(context.route.port)});
    }
    if (!settings.user.empty()) {
        Append(&words, {"-l", settings.user});
    }
    if (context.route.is_known) {
        Append(&words, {"-o", "StrictHostKeyChecking=yes", "-o",
                        "HostKeyAlias=" + ServerName(context.route.name)});
    } else {
        Append(&words, {"-o", "StrictHostKeyChecking=accept-new"});
    }
    const std::string known_hosts = DoubledPercent(RootPath(kKnownHostsPath));
    for (const std::string& option : {
             "UserKnownHostsFile=\"" + known_hosts + "\"",
             "BatchMode=" + std::string(settings.password.empty() ? "yes" : "no"),
             std::string("NumberOfPasswordPrompts=1"),
             "ConnectTimeout=" + std::to_string(ConnectTimeout(settings)),
             "ServerAliveInterval=" + std::to_string(kSshAliveInterval),
             "ServerAliveCountMax=" + std::to_string(kSshAliveCount),
             std::string("ForwardX11=no"),
             std::string("ForwardAgent=no"),
             std::string("ControlPath=none"),
             std::string("LogLevel=ERROR"),
         }) {
        Append(&words, {"-o", option});
    }
    return words;
}

// ssh asks a program of ours for the password.
void AddAskpass(const std::string& password, Invocation* invocation) {
    if (password.empty()) {
        return;
    }
    const SecretFile& secret = invocation->secrets.emplace_back(password + "\n");
    Append(&invocation->environment,
           {"SSH_ASKPASS=" + HelperProgram("askpass"), "SSH_ASKPASS_REQUIRE=force",
            "TARQRSYNC_SECRET=" + secret.Path()});
}

// rsync runs this line in a shell, which the command replaces, and substitutes the host for %H, so
// percent signs of our own are doubled.
void SetConnectProgram(const Words& words, Invocation* invocation) {
    invocation->environment.push_back("RSYNC_CONNECT_PROG=exec " +
                                      DoubledPercent(QuoteForShell(words)));
}

// The way to the daemon, or to the directory. Returns the "user@host:" or "host:" that stands
// before a path.
std::string AddTransport(const InvocationContext& context, Invocation* invocation) {
    const Settings& settings = context.settings;
    const Route& route = context.route;
    Words* arguments = &invocation->arguments;
    if (settings.timeout > 0) {
        arguments->push_back("--timeout=" + std::to_string(settings.timeout));
    }
    // A server's greeting is not mixed with what rsync itself says.
    arguments->push_back("--no-motd");
    const std::string timeout = std::to_string(ConnectTimeout(settings));
    switch (route.transport) {
        case Transport::DAEMON:
            Append(arguments, {"--port=" + std::to_string(route.port), "--sockopts=TCP_NODELAY",
                               "--contimeout=" + timeout});
            break;
        case Transport::DAEMON_OVER_TLS:
            // As a remote shell, rsync starts it without a shell between and talks to it over unix
            // sockets; RSYNC_CONNECT_PROG would cost a third more of a command's time.
            arguments->push_back(
                "--rsh=" +
                QuoteForRsh({HelperProgram("connect"), settings.host, std::to_string(route.port),
                             timeout, std::to_string(settings.timeout), route.fingerprint}));
            break;
        case Transport::DAEMON_OVER_SSH: {
            AddAskpass(settings.password, invocation);
            Words words = SshWords(context);
            Append(&words, {"-W", kLoopback + (":" + std::to_string(context.config.daemon_port)),
                            "--", settings.host});
            SetConnectProgram(words, invocation);
            break;
        }
        case Transport::DIRECTORY_OVER_SSH:
            AddAskpass(settings.password, invocation);
            arguments->push_back("--rsh=" + QuoteForRsh(SshWords(context)));
            return HostForRsync(settings.host) + ":";
    }
    if (!settings.account || settings.user.empty()) {
        return HostForRsync(settings.host) + "::";
    }
    arguments->push_back("--password-file=-");
    invocation->input = settings.password + "\n";
    return settings.user + "@" + HostForRsync(settings.host) + "::";
}

void AddLog(const InvocationContext& context, Words* arguments) {
    if (!context.log_file.empty()) {
        // An empty format keeps out a line for each file.
        Append(arguments, {"--log-file=" + context.log_file, "--log-file-format="});
    }
}

// The rule for all that is below what `rule` names. In a pattern with wildcards a backslash
// escapes.
std::string RuleForBelow(const std::string& rule) {
    const bool has_wildcards = rule.find_first_of("*?[") != std::string::npos;
    std::string below;
    for (const char c : rule) {
        below += std::string(c == '\\' && !has_wildcards ? "\\" : "") + c;
    }
    return below + (below.back() == '/' ? "**" : "/**");
}

void AddRules(const InvocationContext& context, PrivateFolder* folder, Words* arguments) {
    std::vector<std::string> rules;
    for (const std::string& rule : context.settings.exclude_rules) {
        if (rule.empty()) {
            continue;
        }
        rules.push_back(rule);
        // What is named is looked for in these rules by its own name, not by those of the folders
        // above it.
        if (context.settings.relative_path || !context.options.files.empty() ||
            !context.options.changes.empty()) {
            rules.push_back(RuleForBelow(rule));
        }
    }
    size_t size = 0;
    for (const std::string& rule : rules) {
        size += rule.size();
    }
    // Each rule gets its own "- " in both forms: rsync would otherwise take a leading "+ " as the
    // opposite, "!" as the end of all rules before it, and, in a file, "#recycle" as a comment.
    std::string list;
    for (const std::string& rule : rules) {
        if (size > kMaxRuleBytes) {
            list += "- " + rule + '\0';
        } else {
            arguments->push_back("--filter=- " + rule);
        }
    }
    if (!list.empty()) {
        Append(arguments, {"--from0", "--exclude-from=" + folder->Write("rules", list)});
    }
}

// These paths alone. Without the head, a name that begins with "#" or ";" would be a comment. rsync
// takes a slash off; with "./", the top folder itself comes along.
void AddList(const std::vector<std::string>& paths, const char* head, const char* tail,
             PrivateFolder* folder, Words* arguments) {
    if (paths.empty()) {
        return;
    }
    std::string list;
    for (const std::string& path : paths) {
        list += head + path + (path.empty() ? "" : tail) + '\0';
    }
    Append(arguments, {"--from0", "--files-from=" + folder->Write("paths", list)});
}

// What is excluded stays, wherever it is named: the receiving side asks for the rules, too.
void AddChanges(const InvocationContext& context, PrivateFolder* folder, Words* arguments) {
    const RunOptions& options = context.options;
    if (options.changes.empty()) {
        return;
    }
    AddList(options.changes, "./", options.shallow ? "/" : "", folder, arguments);
    if (options.shallow) {
        Append(arguments, {"--no-recursive", "--dirs"});
    }
    // What has gone since it was noticed is a change of its own.
    arguments->push_back(context.settings.deletes_changes ? "--delete-missing-args"
                                                          : "--ignore-missing-args");
}

void AddReporting(const RunOptions& options, Words* arguments) {
    // rsync says when the log-in is over and it turns to the files, and how many there are before
    // any is sent.
    arguments->push_back("--info=flist2");
    if (options.on_progress) {
        // Each file is told as it is checked, the ones that are in step as well (-ii).
        Append(arguments, {"--info=progress2", "--outbuf=N", "-ii"});
    }
    if (options.on_change || options.on_progress) {
        arguments->push_back("--out-format=" + std::string(kChangeMark) + "%i %l %n");
    }
    if (options.report != nullptr) {
        // Before rsync 3.4 the closing figures miss what is deleted last: each deletion is told.
        Append(arguments, {"--stats", "--info=del1"});
    }
    if (options.dry_run) {
        arguments->push_back("--dry-run");
    }
    if (options.by_content) {
        arguments->push_back("--checksum");
    }
    if (options.bandwidth_limit != 0) {
        arguments->push_back("--bwlimit=" + std::to_string(options.bandwidth_limit));
    }
}

void AddReservedNames(Words* arguments) {
    for (const char* const name : kReservedNames) {
        arguments->push_back(std::string("--filter=- /") + name);
    }
}

// Whether rsync keeps what it has of a broken file in the file's own folder: where no server takes
// it out of the way, or where the server has put it there for this run.
bool LeavesPartsBeside(const InvocationContext& context) {
    return context.versions.empty() ? context.settings.delta_copy : context.options.resume;
}

void AddCopyOptions(const InvocationContext& context, Words* arguments) {
    const Settings& settings = context.settings;
    // Times are compared to the nanosecond. rsync looks at whole seconds otherwise: what is changed
    // twice within one, keeping its size, would stay at the first change for ever.
    Append(arguments, {"-rlptgo", "--modify-window=-1", "--no-h", "--8-bit-output"});
    if (settings.pseudo_root) {
        // Devices and special files can be kept by a receiver that need not be root.
        arguments->push_back("-D");
        if (context.route.transport == Transport::DIRECTORY_OVER_SSH) {
            arguments->push_back("-M--fake-super");
        }
    }
    if (context.acls) {
        arguments->push_back("-A");
    }
    if (context.xattrs) {
        arguments->push_back("-X");
    }
    if (settings.numeric_ids) {
        arguments->push_back("--numeric-ids");
    }
    if (settings.compress) {
        arguments->push_back("-z");
    }
    if (settings.relative_path) {
        arguments->push_back("--relative");
    }
    const bool resumes = context.options.resume && !context.versions.empty();
    arguments->push_back(settings.delta_copy || resumes ? "--no-whole-file" : "--whole-file");
    if (LeavesPartsBeside(context)) {
        arguments->push_back(std::string("--partial-dir=") + kResumedFolder);
    }
    if (settings.delete_missing) {
        // Only after everything else has been read and sent is it known that the source could be
        // read in full: rsync then deletes, and after an error at the source it does not.
        arguments->push_back("--delete-after");
        if (LeavesPartsBeside(context)) {
            // What broken runs have left behind and no run has used is deleted like anything else.
            arguments->push_back("--filter=R " + std::string(kResumedFolder) + "/");
        }
    }
}

// What comes back is what the server holds, as it is there. Whole files: the server is told nothing
// of what the files here contain.
void AddPullOptions(const InvocationContext& context, PrivateFolder* folder, Words* arguments) {
    const Settings& settings = context.settings;
    const PullOptions& pull = *settings.pull;
    Append(arguments, {"-rlpt", "--modify-window=-1", "--whole-file", "--no-h", "--8-bit-output"});
    if (geteuid() == 0) {
        Append(arguments, {"-goD", "--numeric-ids"});
    } else {
        // A program that ran as its owner would run as whoever brings it back.
        arguments->push_back("--chmod=Fug-s");
    }
    if (context.acls) {
        arguments->push_back("-A");
    }
    if (context.xattrs) {
        arguments->push_back("-X");
    }
    if (settings.compress) {
        arguments->push_back("-z");
    }
    if (pull.keep_existing) {
        arguments->push_back("--ignore-existing");
    }
    arguments->push_back("--filter=- " + std::string(kResumedFolder) + "/");
    AddReservedNames(arguments);
    AddList(pull.paths, "/", "", folder, arguments);
}

// What is replaced or deleted is renamed to a folder of the run's own: that costs no copying, and
// two runs at once never overwrite what the other has left. Neither --inplace nor --append may ever
// stand beside it: they change a file instead of replacing it, and nothing of it would be left.
//
// Files are written in another such folder and renamed from there. So what a run has left of a
// file is found without a search, however it ended: the server keeps it there. It is not named as
// --partial-dir, since rsync would then look there for a part of each file, also of those that need
// not be sent.
void AddVersions(const InvocationContext& context, Words* arguments) {
    if (!context.versions.empty()) {
        const auto own = [&](const char* folder) {
            return std::string("=") + folder + "/" + context.versions;
        };
        Append(arguments, {"--backup", "--backup-dir" + own(kVersionsFolder),
                           "--temp-dir" + own(kPartialsFolder)});
    }
    if (context.options.keep_versions) {
        AddReservedNames(arguments);
    }
}

// A relative path with a colon would be taken for a host's name.
std::string SourceArgument(const std::string& source) {
    return source[0] == '/' ? source : "./" + source;
}

// The daemon's "module/sub" or the directory's "/path/sub".
std::string PathAtServer(const Settings& settings) {
    std::string path = settings.module;
    if (path.back() != '/') {
        path += "/";
    }
    const size_t start = settings.sub_path.find_first_not_of('/');
    return start == std::string::npos ? path : path + settings.sub_path.substr(start);
}

}  // namespace

std::string SearchPath() {
    const char* const path = getenv("PATH");
    return path != nullptr ? path : kDefaultPath;
}

Words BaseEnvironment() {
    Words environment = {"LC_ALL=C", "PATH=" + SearchPath()};
    for (const char* name : {"TZ", "SSH_AUTH_SOCK", "LOGNAME"}) {
        if (const char* value = getenv(name)) {
            environment.push_back(std::string(name) + "=" + value);
        }
    }
    return environment;
}

int ConnectTimeout(const Settings& settings) {
    return settings.timeout > 0 ? std::min(settings.timeout, kConnectTimeout) : kConnectTimeout;
}

Invocation CopyInvocation(const InvocationContext& context, PrivateFolder* folder) {
    const Settings& settings = context.settings;
    Invocation invocation;
    invocation.environment = BaseEnvironment();
    const std::string server = AddTransport(context, &invocation);
    Words* arguments = &invocation.arguments;
    if (settings.list_only) {
        Append(arguments, {"-r", "--list-only", "--no-h", "--8-bit-output"});
    } else {
        settings.pull ? AddPullOptions(context, folder, arguments)
                      : AddCopyOptions(context, arguments);
        AddReporting(context.options, arguments);
        AddVersions(context, arguments);
        AddList(context.options.files, "/", "", folder, arguments);
        AddChanges(context, folder, arguments);
    }
    AddRules(context, folder, arguments);
    if (!context.start_file.empty()) {
        arguments->push_back("--early-input=" + context.start_file);
    }
    AddLog(context, arguments);
    arguments->push_back("--");
    const std::string far_end = server + PathAtServer(settings);
    if (settings.list_only) {
        arguments->push_back(far_end);
    } else if (settings.pull) {
        Append(arguments, {far_end, SourceArgument(settings.source) + "/"});
    } else {
        const bool is_open = context.options.source_folder >= 0;  // and rsync runs in it
        Append(arguments, {is_open ? "./" : SourceArgument(settings.source), far_end});
    }
    return invocation;
}

Invocation CommandInvocation(const InvocationContext& context, const std::string& command_file,
                             const std::string& session, const std::string& answer_file) {
    Invocation invocation;
    invocation.environment = BaseEnvironment();
    const std::string server = AddTransport(context, &invocation);
    // Without -l and -D nothing but a regular file is ever made here.
    Append(&invocation.arguments, {"--early-input=" + command_file, "--8-bit-output",
                                   "--max-size=" + std::to_string(kMaxAnswerBytes)});
    AddLog(context, &invocation.arguments);
    Append(&invocation.arguments, {"--", server + kCommandModule + "/" + session, answer_file});
    return invocation;
}

std::string QuoteForRsh(const Words& words) {
    return Joined(words, "''");
}

std::string QuoteForShell(const Words& words) {
    return Joined(words, "'\\''");
}

}  // namespace Backup
}  // namespace TARQ
