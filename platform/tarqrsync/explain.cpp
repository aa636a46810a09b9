#include "platform/tarqrsync/explain.h"

#include <algorithm>
#include <initializer_list>
#include <iterator>
#include <string_view>
#include <utility>

#include "base/text.h"
#include "platform/tarqrsync/message_keeper.h"
#include "platform/tarqrsync/output_parser.h"
#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

namespace {

// rsync's exit codes that have no name in the public header.
constexpr int kExitProtocol = 2;
constexpr int kExitUnsupported = 4;
constexpr int kExitFileIo = 11;
constexpr int kExitIpc = 14;
constexpr int kExitPartial = 23;
constexpr int kExitVanished = 24;
constexpr int kExitConnectTimeout = 35;
// What ssh ends with when it fails by itself.
constexpr int kExitSsh = 255;

constexpr int kKeepStatus = -1;

constexpr std::string_view kUnknownModule = "@ERROR: Unknown module";
constexpr std::string_view kEarlyExecFailed = "@ERROR: early exec failed";
// In a copy that ran to its end every complaint of the sending half is about the source.
constexpr std::string_view kSourceComplaint = "[sender] ";

enum Where : unsigned int {
    DAEMON = 1U,
    COMMAND = 2U,  // a server command
    COPY = 4U,
    SSH = 8U,  // either of the runs over ssh
    TLS = 16U,
    PULL = 32U,  // a copy that comes from the server
    ANYWHERE = DAEMON | COMMAND | COPY | SSH | TLS | PULL
};

// Words of rsync's, ssh's or our connecting program's, and what they mean to a person. {host},
// {user}, {module}, {port}, {daemon_port}, {ssh}, and {line} (all of the line that the words were
// found in) are filled in.
struct Clue {
    std::string_view words;
    unsigned int where;
    int status;
    std::string_view meaning;
};

// The first that fits holds, so the causes stand before what follows from them.
constexpr Clue kClues[] = {
    {"Could not resolve hostname", SSH, STATUS_SOCKET, "the host name {host} is unknown"},
    {"UNPROTECTED PRIVATE KEY FILE", SSH, STATUS_AUTHENTICATION,
     "ssh refuses the private key: others may read its file"},
    {"ssh_askpass: exec", SSH, STATUS_AUTHENTICATION,
     "the program that hands the password to ssh cannot be run: is /tmp mounted with noexec?"},
    {"stdio forwarding failed", SSH, STATUS_SOCKET,
     "the ssh login at {host} works, but no rsync daemon answers there on port {daemon_port}, or "
     "its ssh server forbids the way to it (AllowTcpForwarding)"},
    {"Connection timed out", SSH, kExitConnectTimeout,
     "{host} did not answer on ssh port {port} in time"},
    {"Operation timed out", SSH, kExitConnectTimeout,
     "{host} did not answer on ssh port {port} in time"},
    {"Connection refused", SSH, STATUS_SOCKET,
     "{host} refuses connections on ssh port {port}: is its ssh server running?"},
    {"Too many authentication failures", SSH, STATUS_AUTHENTICATION,
     "the ssh login of '{user}' at {host} was refused: too many keys were offered"},
    {"ssh: not found", SSH, kExitIpc, "the program {ssh} is missing"},
    {"Failed to exec", SSH, kExitIpc, "the program {ssh} cannot be started"},
    {"rsync: command not found", SSH, kKeepStatus, "{host} has no rsync program"},
    {"rsync: not found", SSH, kKeepStatus, "{host} has no rsync program"},
    {"connect: cannot find", TLS, STATUS_SOCKET, "the host name {host} is unknown"},
    {"connect: timed out", TLS, kExitConnectTimeout,
     "{host} did not answer on TLS port {port} in time"},
    {"Connection timed out", TLS, kExitConnectTimeout,
     "{host} did not answer on TLS port {port} in time"},
    {"Connection refused", TLS, STATUS_SOCKET,
     "{host} refuses connections on TLS port {port}: is its server running?"},
    {"connect: no TLS", TLS, STATUS_SOCKET,
     "what answers at {host} on port {port} is no server with TLS 1.3: {line}"},
    {"getaddrinfo:", DAEMON, kKeepStatus, "the host name {host} is unknown"},
    {"Connection refused", DAEMON, kKeepStatus,
     "{host} refuses connections on port {port}: is its rsync daemon running?"},
    {"No route to host", ANYWHERE, STATUS_SOCKET, "there is no way to {host} in the network"},
    {"Network is unreachable", ANYWHERE, STATUS_SOCKET, "there is no way to {host} in the network"},
    {"Connection timed out", DAEMON, kKeepStatus, "{host} did not answer on port {port} in time"},
    {"failed to read a password", ANYWHERE, STATUS_AUTHENTICATION,
     "{host} asks for a password and none is set"},
    {"@ERROR: auth failed", ANYWHERE, kKeepStatus,
     "{host} refused the login: wrong account or password, or an account without rights there"},
    {"@ERROR: access denied", ANYWHERE, kKeepStatus,
     "{host} does not let this machine reach the module {module}"},
    {"@ERROR: max connections", ANYWHERE, kKeepStatus,
     "{host} serves as many connections as it takes: try again later"},
    {kUnknownModule, COMMAND, STATUS_UNKNOWN_COMMAND,
     "{host} takes no server commands: its rsync daemon has no module for them"},
    {kUnknownModule, COPY | PULL, kKeepStatus, "{host} has no module '{module}'"},
    {kEarlyExecFailed, COPY, kKeepStatus, "{host} does not start this push in one connection"},
    {kEarlyExecFailed, ANYWHERE, kKeepStatus, "the program that takes commands at {host} failed"},
    {"@ERROR: Unknown command", COMMAND, STATUS_UNKNOWN_COMMAND,
     "the rsync daemon at {host} is older than 3.2.1 and takes no commands"},
    {"configured to refuse", ANYWHERE, kKeepStatus,
     "the rsync daemon at {host} is configured to refuse an option of this run"},
    {"module is read only", ANYWHERE, kKeepStatus, "the module {module} at {host} is read-only"},
    {"Refused: this server keeps", COPY, kKeepStatus, "{line}"},
    {"@ERROR:", ANYWHERE, kKeepStatus, "{host} refused the run: {line}"},
    {"connection unexpectedly closed", ANYWHERE, kKeepStatus,
     "{host} closed the connection in the middle of the run: its rsync, or all of it, was stopped"},
    {"Connection reset by peer", ANYWHERE, kKeepStatus,
     "{host} broke the connection off: its rsync, or all of it, was stopped"},
    {"No space left on device", COPY, kKeepStatus, "the disk of {host} is full"},
    {"Disk quota exceeded", COPY, kKeepStatus,
     "the disk quota of the account at {host} is used up"},
    {"Read-only file system", COPY, kKeepStatus, "the file system at {host} is read-only"},
    {"No space left on device", COMMAND | PULL, kKeepStatus, "the local disk is full"},
    {"Disk quota exceeded", PULL, kKeepStatus, "your disk quota on this machine is used up"},
    {"Read-only file system", PULL, kKeepStatus,
     "the file system to restore into is read-only: {line}"},
    {"[sender] link_stat", PULL, kKeepStatus, "the copy has no such path: {line}"},
    {kSourceComplaint, PULL, kKeepStatus, "{host} cannot read all of the copy: {line}"},
    {"[sender] link_stat", COMMAND, kKeepStatus,
     "{host} took the command and left no answer to it"},
};

// What the exit code alone says.
struct ExitMeaning {
    int code;
    std::string_view meaning;
};

constexpr ExitMeaning kExitMeanings[] = {
    {STATUS_SYNTAX, "rsync does not take the options of this run"},
    {kExitProtocol, "the rsync at {host} speaks a protocol that this one does not know"},
    {STATUS_FILE_SELECT, "the source or the destination cannot be reached"},
    {kExitUnsupported, "the rsync at {host} does not support an option of this run"},
    {STATUS_AUTHENTICATION, "{host} did not start the run"},
    {STATUS_SOCKET, "the connection to {host} failed"},
    {kExitFileIo, "a file could not be written or read"},
    {STATUS_PROTOCOL_STREAM, "the connection to {host} broke"},
    {kExitIpc, "rsync could not start its other half"},
    {STATUS_CANCELLED, "rsync was ended by a signal on this machine"},
    {kExitPartial, "not everything could be copied"},
    {kExitVanished,
     "some files vanished from the source during the run; all others were copied, and "
     "nothing needs to be done"},
    {STATUS_TIMEOUT, "nothing moved between here and {host} for the time-out"},
    {kExitConnectTimeout, "{host} did not answer in time"},
};

// The most bytes of a far end's line that are quoted in a sentence.
constexpr size_t kMaxQuoted = 400;

std::string LineAt(std::string_view text, size_t position) {
    const size_t before = text.rfind('\n', position);
    const size_t start = before == std::string_view::npos ? 0 : before + 1;
    const std::string_view line = text.substr(start, text.find('\n', position) - start);
    return line.size() <= kMaxQuoted ? std::string(line)
                                     : std::string(line.substr(0, kMaxQuoted)) + "...";
}

// rsync's message about one file begins like this; the name of the half that reports it follows.
constexpr std::string_view kComplaint = "rsync: [";

// ": WORDS OF THE FIRST, and 12 more" for the lines of `messages` that begin with `head`; empty
// when there is none.
std::string Complaints(std::string_view messages, std::string_view head) {
    std::string first;
    size_t more = 0;
    for (size_t at = messages.find(head); at != std::string_view::npos;
         at = messages.find(head, at + 1)) {
        if (at != 0 && messages[at - 1] != '\n') {
            continue;
        }
        if (first.empty()) {
            const std::string line = LineAt(messages, at);
            const size_t words = line.find("] ");
            first = line.substr(words == std::string::npos ? 0 : words + 2);
        } else {
            ++more;
        }
    }
    const bool cut = messages.find(kLeftOut) != std::string_view::npos;
    return first.empty() ? ""
           : cut         ? ": " + first + ", and many more"
           : more > 0    ? ": " + first + ", and " + std::to_string(more) + " more"
                         : ": " + first;
}

bool Contains(std::string_view text, std::string_view words) {
    return text.find(words) != std::string_view::npos;
}

std::string PortOf(const RunFacts& facts) {
    return facts.route.port != 0 ? std::to_string(facts.route.port) : "22";
}

std::string Fill(std::string_view meaning, const RunFacts& facts, std::string_view line) {
    const Settings& settings = facts.settings;
    const std::initializer_list<std::pair<std::string_view, std::string>> fields = {
        {"{host}", facts.route.name},
        {"{user}", settings.user},
        {"{module}", settings.module},
        {"{port}", PortOf(facts)},
        {"{daemon_port}", std::to_string(facts.config.daemon_port)},
        {"{ssh}", facts.config.ssh},
        {"{line}", std::string(line)},
    };
    std::string result;
    while (!meaning.empty()) {
        const auto field = std::find_if(fields.begin(), fields.end(), [meaning](const auto& entry) {
            return meaning.substr(0, entry.first.size()) == entry.first;
        });
        const size_t width = field == fields.end() ? 1 : field->first.size();
        result += field == fields.end() ? std::string(meaning.substr(0, 1)) : field->second;
        meaning.remove_prefix(width);
    }
    return result;
}

// ssh: "user@host: Permission denied (publickey,password)."; rsync writes a number between the
// brackets.
bool IsRefusedSshLogin(std::string_view text) {
    constexpr std::string_view kWords = "Permission denied (";
    for (size_t at = text.find(kWords); at != std::string_view::npos;
         at = text.find(kWords, at + 1)) {
        const size_t reason = at + kWords.size();
        if (reason < text.size() && base::IsLetter(text[reason])) {
            return true;
        }
    }
    return false;
}

// What mends it when the key of a server that was trusted has changed.
std::string TrustAnew(const RunFacts& facts) {
    return ". Somebody may be in between; if the server was set up anew: zelctl trust " +
           facts.route.name;
}

// The connecting program: "connect: key SHA256:... is not SHA256:..."
constexpr std::string_view kOtherKey = "connect: key ";

std::string ChangedTlsKey(const RunFacts& facts) {
    const size_t begin = facts.messages.find(kOtherKey) + kOtherKey.size();
    const std::string shown = facts.messages.substr(begin, facts.messages.find(' ', begin) - begin);
    return "the server's key is not the one that was trusted: " + facts.route.name + " shows " +
           shown + ", trusted was " + facts.route.fingerprint + TrustAnew(facts);
}

// "Offending ED25519 key in /path/known_hosts:7" tells where the old key stands.
std::string ChangedHostKey(const RunFacts& facts) {
    if (facts.route.is_known) {
        return Contains(facts.messages, "IDENTIFICATION HAS CHANGED")
                   ? "the server's host key is not the one that was trusted for " +
                         facts.route.name + TrustAnew(facts) + " --ssh"
                   : "no host key of " + facts.route.name +
                         " is trusted, or none of the kind that it shows: zelctl trust " +
                         facts.route.name + " --ssh";
    }
    std::string result =
        "the host key of " + facts.route.name +
        " has changed: either it was set up anew or another machine answers in its place";
    constexpr std::string_view kPlace = " key in ";
    const size_t offending = facts.messages.find("Offending ");
    const size_t place = facts.messages.find(kPlace, std::min(offending, facts.messages.size()));
    if (place != std::string::npos) {
        const std::string_view rest =
            std::string_view(facts.messages).substr(place + kPlace.size());
        const std::string_view where = rest.substr(0, rest.find('\n'));
        const size_t colon = where.rfind(':');
        if (colon != std::string_view::npos) {
            result += "; if it was, remove line " + std::string(where.substr(colon + 1)) + " of " +
                      std::string(where.substr(0, colon));
        }
    }
    return result;
}

unsigned int WhereOf(const RunFacts& facts) {
    const Where transport = facts.route.transport == Transport::DAEMON            ? DAEMON
                            : facts.route.transport == Transport::DAEMON_OVER_TLS ? TLS
                                                                                  : SSH;
    return transport | (facts.settings.is_command ? COMMAND : facts.settings.pull ? PULL : COPY);
}

// Runs that came so far that names of files stand in the words: a file may be called "Connection
// refused".
bool CameToFiles(int exit_code) {
    return exit_code == kExitFileIo || exit_code == kExitPartial || exit_code == kExitVanished;
}

// A server's own refusal of an argument that an earlier version does not know, and what a receiver
// says that takes the entry of a missing path for a broken one.
constexpr std::string_view kUnknownArguments[] = {
    "Refused: rsync's argument '--delete-missing-args'", "Refused: rsync's argument '--no-r'"};
constexpr std::string_view kNoSuchMode = "invalid file mode 00 for ";

RunCause RefusedForm(const RunFacts& facts) {
    const bool unknown =
        std::any_of(std::begin(kUnknownArguments), std::end(kUnknownArguments),
                    [&](std::string_view words) { return Contains(facts.messages, words); });
    if (unknown && !CameToFiles(facts.exit_code)) {
        return RunCause::NO_LISTED_CHANGES;
    }
    return facts.exit_code == kExitProtocol && Contains(facts.messages, kNoSuchMode)
               ? RunCause::NO_NAMED_DELETIONS
               : RunCause::NONE;
}

bool IsUnreadableSource(const RunFacts& facts) {
    return facts.exit_code == kExitPartial && !facts.settings.is_command && !facts.settings.pull &&
           !facts.settings.list_only && Contains(facts.messages, kSourceComplaint);
}

// A name that led to something else, or to nothing, when rsync came back to it ends the complaint
// with one of these: ENOENT, ENOTDIR, EISDIR, ELOOP, ENODATA (the file was cut short).
constexpr std::string_view kFleetingErrors[] = {" (2)", " (20)", " (21)", " (40)", " (61)"};
// What else rsync writes in such a run.
constexpr std::string_view kFleetingWords[] = {
    "file has vanished: ", "directory has vanished: ", "IO error encountered -- skipping",
    "rsync error: some files/attrs were not transferred"};
constexpr std::string_view kChangedWhileSent = " failed verification -- update ";

bool StartsWith(std::string_view text, std::string_view words) {
    return text.substr(0, words.size()) == words;
}

bool EndsWith(std::string_view text, std::string_view words) {
    return text.size() >= words.size() && text.substr(text.size() - words.size()) == words;
}

// The entry that a complaint is about, as rsync writes it: [sender] opendir "/share/a" failed, or
// ERROR: a failed verification -- update discarded. Empty: the line does not tell.
std::string_view EntryIn(std::string_view line) {
    constexpr std::string_view kError = "ERROR: ";
    const size_t changed = line.find(kChangedWhileSent);
    if (StartsWith(line, kError) && changed != std::string_view::npos) {
        return line.substr(kError.size(), changed - kError.size());
    }
    const size_t begin = line.find('"');
    const size_t end = line.rfind('"');
    return Contains(line, kSourceComplaint) && end > begin ? line.substr(begin + 1, end - begin - 1)
                                                           : std::string_view();
}

bool IsFleeting(std::string_view line) {
    if (Contains(line, kSourceComplaint)) {
        return std::any_of(std::begin(kFleetingErrors), std::end(kFleetingErrors),
                           [line](std::string_view error) { return EndsWith(line, error); });
    }
    return line.empty() || Contains(line, kChangedWhileSent) ||
           std::any_of(std::begin(kFleetingWords), std::end(kFleetingWords),
                       [line](std::string_view words) { return StartsWith(line, words); });
}

// Whether all that rsync complains of comes from a source that is being changed. One line of any
// other kind, and it does not.
bool IsBusySource(const RunFacts& facts) {
    std::string_view rest = facts.messages;
    if (facts.exit_code != kExitPartial || facts.settings.is_command || facts.settings.pull ||
        !(Contains(rest, kSourceComplaint) || Contains(rest, kChangedWhileSent))) {
        return false;
    }
    while (!rest.empty()) {
        const std::string_view line = rest.substr(0, rest.find('\n'));
        if (!IsFleeting(line)) {
            return false;
        }
        rest.remove_prefix(std::min(line.size() + 1, rest.size()));
    }
    return true;
}

Verdict IncompleteSource(const RunFacts& facts, RunCause cause) {
    const std::string_view messages = facts.messages;
    const std::string which = Complaints(messages, "rsync: [sender] ");
    std::string line =
        (cause == RunCause::BUSY_SOURCE ? "the source changed while it was read"
                                        : "the source cannot be read in full") +
        (!which.empty() ? which : ": " + LineAt(messages, messages.find(kChangedWhileSent)));
    if (facts.settings.delete_missing && !facts.settings.deletes_changes) {
        line += "; nothing was deleted at the destination";
    }
    return {facts.exit_code, cause, line};
}

Verdict FromWords(const RunFacts& facts, int status) {
    const unsigned int where = WhereOf(facts);
    const std::string_view messages = facts.messages;
    const bool connected = CameToFiles(status);
    if ((where & TLS) != 0 && Contains(messages, kOtherKey)) {
        return {STATUS_AUTHENTICATION, RunCause::NONE, ChangedTlsKey(facts)};
    }
    if ((where & SSH) != 0 && !connected) {
        if (Contains(messages, "Host key verification failed") ||
            Contains(messages, "HOST IDENTIFICATION HAS CHANGED")) {
            return {STATUS_AUTHENTICATION, RunCause::NONE, ChangedHostKey(facts)};
        }
        if (IsRefusedSshLogin(messages)) {
            return {
                STATUS_AUTHENTICATION, RunCause::NONE,
                Fill("the ssh login of '{user}' at {host} was refused: wrong account or password",
                     facts, "")};
        }
    }
    for (const Clue& clue : kClues) {
        const size_t position = messages.find(clue.words);
        const bool about_connection = (clue.where & (DAEMON | SSH | TLS)) != 0;
        if ((clue.where & where) != 0 && position != std::string_view::npos &&
            !(connected && about_connection)) {
            return {clue.status == kKeepStatus ? status : clue.status,
                    clue.words == kUnknownModule ? RunCause::UNKNOWN_MODULE
                    : clue.words == kEarlyExecFailed && clue.where == COPY ? RunCause::NOT_STARTED
                                                                           : RunCause::NONE,
                    Fill(clue.meaning, facts, LineAt(messages, position))};
        }
    }
    for (const ExitMeaning& meaning : kExitMeanings) {
        if (meaning.code == status) {
            const std::string which = CameToFiles(status) && status != kExitVanished
                                          ? Complaints(messages, kComplaint)
                                          : "";
            return {status, RunCause::NONE, Fill(meaning.meaning, facts, "") + which};
        }
    }
    return {status, RunCause::NONE, "rsync failed with exit code " + std::to_string(status)};
}

// Whether the rsync here got a signal: it says so itself, and which half it is. The far end's says
// the same of its own.
bool WasEndedHere(const RunFacts& facts) {
    const std::string_view messages = facts.messages;
    const size_t said = messages.find("(code 20)");
    const std::string line = said == std::string_view::npos ? "" : LineAt(messages, said);
    const bool sender = Contains(line, "[sender") || Contains(line, "[Sender");
    const bool receives_here = facts.settings.is_command || facts.settings.pull;
    const bool started_up = Contains(line, "[client") || Contains(line, "[server");
    return line.empty() || (started_up ? Contains(line, "[client") : sender != receives_here);
}

}  // namespace

std::vector<std::string> IncompleteEntries(const RunFacts& facts, bool* all) {
    std::vector<std::string> entries;
    const std::string folder = facts.settings.source;
    *all = true;
    std::string_view rest = facts.messages;
    while (!rest.empty()) {
        const std::string_view line = rest.substr(0, rest.find('\n'));
        rest.remove_prefix(std::min(line.size() + 1, rest.size()));
        const std::string entry = UnescapeName(EntryIn(line));
        if (entry.empty()) {
            *all = *all && line != kLeftOut && !StartsWith(line, kComplaint);
        } else if (entry[0] != '/') {
            entries.push_back(entry);
        } else if (StartsWith(entry, folder) && entry.size() > folder.size()) {
            entries.push_back(entry.substr(folder.size()));
        } else {
            *all = false;
        }
    }
    return entries;
}

Verdict Judge(const RunFacts& facts) {
    if (const RunCause refused = RefusedForm(facts); refused != RunCause::NONE) {
        return {facts.exit_code, refused, "the server cannot take the changes in this form"};
    }
    if (IsBusySource(facts)) {
        return IncompleteSource(facts, RunCause::BUSY_SOURCE);
    }
    if (IsUnreadableSource(facts)) {
        return IncompleteSource(facts, RunCause::UNREADABLE_SOURCE);
    }
    if (facts.exit_code == STATUS_CANCELLED && !WasEndedHere(facts)) {
        return {STATUS_PROTOCOL_STREAM, RunCause::NONE,
                facts.route.name + " ended the run: its rsync was stopped"};
    }
    // The codes of these two are explanation enough: other messages are not about the cause.
    const bool plain = facts.exit_code == kExitVanished || facts.exit_code == STATUS_TIMEOUT;
    return FromWords(
        plain ? RunFacts{facts.settings, facts.route, facts.config, facts.exit_code, ""} : facts,
        facts.exit_code == kExitSsh ? STATUS_SOCKET : facts.exit_code);
}

RefusedAttributes FindRefusedAttributes(const RunFacts& facts) {
    const std::string_view messages = facts.messages;
    RefusedAttributes refused;
    switch (facts.exit_code) {
        // An rsync built without them, here or there, or a daemon that is configured to refuse
        // them.
        case STATUS_SYNTAX:
        case kExitUnsupported:
            refused.acls =
                Contains(messages, "ACLs are not supported") || Contains(messages, "--acls");
            refused.xattrs = Contains(messages, "xtended attributes are not supported") ||
                             Contains(messages, "--xattrs");
            break;
        // A file system that has none.
        case kExitPartial: {
            const bool unsupported = Contains(messages, "Operation not supported");
            refused.acls = unsupported && Contains(messages, "set_acl");
            refused.xattrs = unsupported && Contains(messages, "xattr");
            break;
        }
        default:
            break;
    }
    return refused;
}

}  // namespace Backup
}  // namespace TARQ
