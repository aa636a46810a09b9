#include "platform/tarqrsync/arguments.h"

#include <algorithm>
#include <cstdlib>

#include "platform/tarqrsync/answer_file.h"
#include "tarq/root_path.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr char kKnownHostsPath[] = "/usr/tarq/etc/tarqrsync_known_hosts";
constexpr char kLoopback[] = "127.0.0.1";
constexpr char kDefaultPath[] = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";

// Seconds that a connection may take to come up: a server that has not answered by then is not
// there, however patient the caller is with a slow copy.
constexpr int kConnectTimeout = 60;
// Seconds after which ssh asks a silent server whether it is still there, and how often before it
// gives up. A slow line that is full may take a while to carry the answer.
constexpr int kSshAliveInterval = 30;
constexpr int kSshAliveCount = 4;

// Where the receiver keeps what it has of a file when a run breaks off. The name is reserved: rsync
// copies no folder of that name.
constexpr char kPartialFolder[] = ".tarqrsync-partial";

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
    if (settings.port != 0) {
        Append(&words, {"-p", std::to_string(settings.port)});
    }
    if (!settings.user.empty()) {
        Append(&words, {"-l", settings.user});
    }
    const std::string known_hosts = DoubledPercent(RootPath(kKnownHostsPath));
    for (const std::string& option : {
             std::string("StrictHostKeyChecking=accept-new"),
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

// Only what a run needs: neither the host's own RSYNC_* and locale nor a ~/.popt changes how rsync
// reads its options, and no other secret of the host's reaches the server's side by way of ssh's
// SendEnv.
Words BaseEnvironment() {
    Words environment = {"LC_ALL=C"};
    const char* path = getenv("PATH");
    environment.push_back(std::string("PATH=") + (path ? path : kDefaultPath));
    for (const char* name : {"TZ", "SSH_AUTH_SOCK", "LOGNAME"}) {
        if (const char* value = getenv(name)) {
            environment.push_back(std::string(name) + "=" + value);
        }
    }
    return environment;
}

// ssh asks a program for the password; the program reads it from a file beside it.
void AddAskpass(const std::string& password, PrivateFolder* folder, Invocation* invocation) {
    if (password.empty()) {
        return;
    }
    const std::string secret = folder->Write("secret", password + "\n");
    const std::string askpass =
        folder->Write("askpass", "#!/bin/sh\nexec /bin/cat " + QuoteForShell({secret}) + "\n",
                      /*executable=*/true);
    Append(&invocation->environment, {"SSH_ASKPASS=" + askpass, "SSH_ASKPASS_REQUIRE=force"});
}

// The way to the daemon, or to the directory. Returns the "user@host:" or "host:" that stands
// before a path.
std::string AddTransport(const InvocationContext& context, PrivateFolder* folder,
                         Invocation* invocation) {
    const Settings& settings = context.settings;
    Words* arguments = &invocation->arguments;
    const Transport transport = TransportOf(settings);
    if (settings.timeout > 0) {
        arguments->push_back("--timeout=" + std::to_string(settings.timeout));
    }
    // A server's greeting is not mixed with what rsync itself says.
    arguments->push_back("--no-motd");
    if (transport != Transport::DAEMON) {
        AddAskpass(settings.password, folder, invocation);
    }
    if (transport == Transport::DIRECTORY_OVER_SSH) {
        arguments->push_back("--rsh=" + QuoteForRsh(SshWords(context)));
        return HostForRsync(settings.host) + ":";
    }

    if (transport == Transport::DAEMON) {
        const int port = settings.port != 0 ? settings.port : context.config.daemon_port;
        Append(arguments, {"--port=" + std::to_string(port), "--sockopts=TCP_NODELAY",
                           "--contimeout=" + std::to_string(ConnectTimeout(settings))});
    } else {
        Words words = SshWords(context);
        Append(&words, {"-W", kLoopback + (":" + std::to_string(context.config.daemon_port)), "--",
                        settings.host});
        // rsync puts the host in the place of %H, so a percent sign of our own is doubled.
        invocation->environment.push_back("RSYNC_CONNECT_PROG=" +
                                          DoubledPercent(QuoteForShell(words)));
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

void AddRules(const Settings& settings, PrivateFolder* folder, Words* arguments) {
    size_t size = 0;
    for (const std::string& rule : settings.exclude_rules) {
        size += rule.size();
    }
    // Each rule gets its own "- " in both forms: rsync would otherwise take a leading "+ " as the
    // opposite, "!" as the end of all rules before it, and, in a file, "#recycle" as a comment.
    std::string list;
    for (const std::string& rule : settings.exclude_rules) {
        if (rule.empty()) {
            continue;
        }
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
    if (options.bandwidth_limit != 0) {
        arguments->push_back("--bwlimit=" + std::to_string(options.bandwidth_limit));
    }
}

void AddCopyOptions(const InvocationContext& context, Words* arguments) {
    const Settings& settings = context.settings;
    // Times are compared to the nanosecond. rsync looks at whole seconds otherwise: what is changed
    // twice within one, keeping its size, would stay at the first change for ever.
    Append(arguments, {"-rlptgo", "--modify-window=-1", "--no-h", "--8-bit-output"});
    if (settings.pseudo_root) {
        // Devices and special files can be kept by a receiver that need not be root.
        arguments->push_back("-D");
        if (TransportOf(settings) == Transport::DIRECTORY_OVER_SSH) {
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
    if (settings.delta_copy) {
        Append(arguments, {"--no-whole-file", std::string("--partial-dir=") + kPartialFolder});
    } else {
        arguments->push_back("--whole-file");
    }
    if (settings.delete_missing) {
        // Only after everything else has been read and sent is it known that the source could be
        // read in full: rsync then deletes, and after an error at the source it does not.
        arguments->push_back("--delete-after");
        if (settings.delta_copy) {
            // What broken runs have left behind and no run has used is deleted like anything else.
            arguments->push_back("--filter=R " + std::string(kPartialFolder) + "/");
        }
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

int ConnectTimeout(const Settings& settings) {
    return settings.timeout > 0 ? std::min(settings.timeout, kConnectTimeout) : kConnectTimeout;
}

Invocation CopyInvocation(const InvocationContext& context, PrivateFolder* folder) {
    const Settings& settings = context.settings;
    Invocation invocation;
    invocation.environment = BaseEnvironment();
    const std::string server = AddTransport(context, folder, &invocation);
    Words* arguments = &invocation.arguments;
    if (settings.list_only) {
        Append(arguments, {"-r", "--list-only", "--no-h", "--8-bit-output"});
    } else {
        AddCopyOptions(context, arguments);
        AddReporting(context.options, arguments);
    }
    AddRules(settings, folder, arguments);
    AddLog(context, arguments);
    arguments->push_back("--");
    if (!settings.list_only) {
        arguments->push_back(SourceArgument(settings.source));
    }
    arguments->push_back(server + PathAtServer(settings));
    return invocation;
}

Invocation CommandInvocation(const InvocationContext& context, const std::string& command_file,
                             const std::string& session, const std::string& answer_file,
                             PrivateFolder* folder) {
    Invocation invocation;
    invocation.environment = BaseEnvironment();
    const std::string server = AddTransport(context, folder, &invocation);
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
