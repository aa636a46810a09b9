// One rsync run: a server command or a copy of files, on the stock rsync and ssh programs.
//
// An RsyncWrapper is configured with its setters, run once with execute(), and thrown away. What a
// caller wants to know or to limit beyond that (progress, bandwidth, a list of what would change)
// it asks for with RunOptions. Those are this platform's own: another host's wrapper may lack them.
#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace TARQ {
namespace Backup {

#pragma GCC visibility push(default)

/// How far a copy has come. What rsync does not tell is left at its default, never guessed.
struct RunProgress {
    /// What `percent` is a share of.
    enum Basis {
        NOTHING,  ///< there is no percentage: the search for files goes on
        FILES,    ///< files checked of all files; what is sent of them is not known beforehand
        BYTES     ///< bytes of all files: the destination was empty, so that all of them travel
    };
    Basis percent_of = NOTHING;
    unsigned int percent = 0;    ///< 0..100; 100 only when nothing is left to send
    uint64_t files_checked = 0;  ///< files, folders and links that are as they should be
    uint64_t files_total = 0;    ///< found so far
    bool totals_final = false;   ///< the search for files has ended
    uint64_t bytes_done = 0;     ///< content of the files that had to be sent, so far
    uint64_t bytes_per_second = 0;
    std::string file;          ///< being sent, as RunChange::path has it; empty between files
    uint64_t file_bytes = 0;   ///< of that file, so far
    uint64_t file_length = 0;  ///< of that file
    /// Since when nothing has moved: no byte of the connection, no word of rsync's.
    unsigned int seconds_still = 0;
};

/// One difference that a run makes, or with a dry run would make, at the destination; or an entry
/// of a listing (SEND for a file).
struct RunChange {
    enum Kind { SEND, DELETE, OTHER /* attributes, directories, links */ };
    Kind kind = OTHER;
    std::string path;  ///< relative to the source, bytes as they are on disk; a folder ends in "/"
    uint64_t length = 0;  ///< size of the file in bytes, for SEND
    /// With RunOptions::by_content, for SEND: size and time are the same at both ends, and the
    /// bytes are not. One of the two is damaged.
    bool damaged = false;
    bool is_new = false;  ///< the destination has nothing of that name; not told in a listing
    /// In a listing alone: the time of modification on this machine's clock, as the number
    /// 20261231235959.
    uint64_t time = 0;
};

/// Why a run failed, where callers act on it; the explanation is for people.
enum class RunCause {
    NONE,               ///< it did not fail, or for a reason of no name here
    UNKNOWN_MODULE,     ///< the server's daemon has no module of that name
    UNREADABLE_SOURCE,  ///< something of the source cannot be read; the rest was copied
    BUSY_SOURCE,  ///< only what changed while it was read is missing: another run may find it at
                  ///< rest
    NO_NAMED_DELETIONS,  ///< the server's rsync cannot take RunOptions::deletes_changes: nothing
                         ///< was done
    NO_LISTED_CHANGES,   ///< the server is of an earlier version and takes neither that nor
                         ///< RunOptions::shallow: nothing was done
    NOT_STARTED  ///< the server does not start RunOptions::start as it stands there: nothing
                 ///< was done
};

/// What a finished run came to.
struct RunReport {
    int status = -1;  ///< what execute() returned; -1 until then
    RunCause cause = RunCause::NONE;
    bool begun = false;        ///< the server has let a copy in: it may have changed something
    std::string explanation;   ///< why it failed, in one sentence for a person; empty after success
    std::string details;       ///< what rsync and ssh wrote about it, line by line; may be empty
    uint64_t files_total = 0;  ///< files, folders and links looked at
    uint64_t files_regular = 0;   ///< regular files among them
    uint64_t folders_total = 0;   ///< folders among them
    uint64_t files_sent = 0;      ///< regular files whose content travelled
    uint64_t files_deleted = 0;   ///< entries deleted at the destination
    uint64_t bytes_total = 0;     ///< size of all files looked at
    uint64_t bytes_sent = 0;      ///< bytes that this side wrote to the connection
    uint64_t bytes_received = 0;  ///< bytes that this side read from it
    /// With UNREADABLE_SOURCE and BUSY_SOURCE: what could not be copied, relative to the source. Of
    /// many complaints not all are kept, see `all_incomplete`.
    std::vector<std::string> incomplete;
    bool all_incomplete = false;  ///< `incomplete` names each of them
};

/// A copy the other way round: what setDestPath() names at the server comes into the folder of
/// setSrcPath(), which has to be there. Nothing in it is deleted, whatever setDelete() says. As
/// root owners and devices come back; another user's files are his own, without set-user-ID bits.
struct PullOptions {
    bool keep_existing = true;  ///< what is there under a name stays as it is
    /// These alone, relative to the module, each with all that is below it, and the folders above
    /// them. The attributes of the folder that they come into stay as they are then. Empty: all,
    /// and the folder gets the attributes of the module's.
    std::vector<std::string> paths;
};

/// What a run does beside its settings. Every member may stay as it is.
struct RunOptions {
    unsigned int bandwidth_limit = 0;  ///< KiB a second; 0: no limit
    bool keep_missing = false;         ///< copies only: delete nothing, whatever setDelete() says
    bool dry_run = false;              ///< copies only: change nothing at the destination
    bool by_content = false;           ///< copies only: every file is read at both ends, and one
                                       ///< is sent when its bytes differ. A large file is read
                                       ///< in silence, so that the time-out is a day
    /// Copies to the server only: the open folder whose content is copied, whatever the path of
    /// setSrcPath() leads to by then; that path names it to people. -1: none, the path counts.
    int source_folder = -1;
    /// Copies to the server only: these files of the source alone, relative to it. Nothing is
    /// deleted. Empty: all.
    std::vector<std::string> files;
    /// Copies to the server only: these paths of the source alone, relative to it; "" is its top. A
    /// file or link is sent, a folder with all that is below it: what setDelete() says holds there
    /// and nowhere else. The folders above them, the top included, get their attributes. None may
    /// be below another. Empty: all.
    std::vector<std::string> changes;
    /// With `changes`: those that are not at the source are deleted at the destination, unless a
    /// rule excludes them. Otherwise they are left out.
    bool deletes_changes = false;
    /// With `changes`, which are folders then: each is compared by its own entries. Of a folder in
    /// it nothing below is sent, and nothing is deleted unless that folder itself is gone.
    bool shallow = false;
    /// rsync gives way to all else on this machine: idle priority of its reading, the least of the
    /// processor. One that reads for `by_content` does so at the server, too.
    bool background = false;
    /// Commands only: for one that may take the server longer than `answer_seconds` of the
    /// configuration. 0: that.
    unsigned int answer_seconds = 0;
    /// Copies into a module of a daemon that keeps versions: what the run replaces or deletes is
    /// moved to a folder of its own below kVersionsFolder, from where the server takes it. An entry
    /// of that name at the root of the copy is neither sent nor deleted. A server of an earlier
    /// version, which refuses such runs, gets the copy without, and the system log says so once.
    /// What a run that breaks has of a file stays below kPartialsFolder, another reserved name.
    bool keep_versions = false;
    /// With `keep_versions`: goes on with the half file that the server has offered.
    bool resume = false;
    /// With `keep_versions`: the lines of a command that starts a push and says exactly which copy
    /// it expects. The run goes to kPushModule, where it is the whole push, with its start and its
    /// end: or fails at once, with the cause NOT_STARTED or, at a server that has no such module,
    /// UNKNOWN_MODULE, of which logError() says nothing. Empty: a run within a push.
    std::list<std::string> start;
    std::string module;  ///< copies only: this module of the daemon in the place of setDestPath's;
                         ///< empty: that one
    std::function<void(const RunProgress&)>
        on_progress;  ///< called on the running thread, at least once a second and at most five
                      ///< times
    std::function<void(const RunChange&)>
        on_change;                ///< called on the running thread, in rsync's order
    RunReport* report = nullptr;  ///< filled when the run ends; the caller's
    /// The server as a person wrote it, where setDestPath() has an address that the name was
    /// resolved to: what is trusted, tarq/rsync_servers.h, is the server of that name. Empty: the
    /// host of setDestPath().
    std::string server;
    std::optional<PullOptions> pull;  ///< copies only: the other way
};

/// Statuses that execute() returns by itself; all others are rsync's exit codes or the server's
/// answer.
enum WrapperStatus : int {
    STATUS_DONE = 0,
    STATUS_SYNTAX = 1,       ///< rsync's own: also an rsync that is too old, and says so
    STATUS_FILE_SELECT = 3,  ///< rsync's own: a source or an answer file cannot be reached
    STATUS_AUTHENTICATION =
        5,               ///< rsync's own: wrong account or password, a module that is not there
    STATUS_SOCKET = 10,  ///< rsync's own: the server cannot be reached
    STATUS_PROTOCOL_STREAM = 12,  ///< rsync's own: the connection broke
    STATUS_CANCELLED = 20,  ///< rsync's own: ended by a signal, which is how a cancelled run ends
    STATUS_TIMEOUT = 30,    ///< rsync's own: nothing moved for the time-out; or a server that does
                            ///< not answer, or a connection that is dead
    STATUS_UNKNOWN_COMMAND = 43,  ///< the server does not know the command, or no commands at all
    STATUS_COMMAND_TOO_LONG =
        50,                     ///< the command has more bytes than rsync carries; nothing was sent
    STATUS_RSYNC_MISSING = 127  ///< the rsync program cannot be started
};

/// The rsync daemon's module that takes server commands.
constexpr const char kCommandModule[] = "zel_command";

/// The rsync daemon's module in which a push starts, sends and ends on one connection: see
/// RunOptions::start. Its name is no share's.
constexpr const char kPushModule[] = ".zel_push";

/// The reserved name at the root of each module below which copies leave versions.
constexpr const char kVersionsFolder[] = ".zel_versions";

/// The reserved name at the root of each module below which copies write files until they are
/// complete.
constexpr const char kPartialsFolder[] = ".zel_partial";

/// The names at the root of each module that are the service's own. No run sends or deletes them.
constexpr const char* kReservedNames[] = {kVersionsFolder, kPartialsFolder};

/// In the folder of a file that a run goes on with, the folder of what there is of it already.
constexpr const char kResumedFolder[] = ".tarqrsync-partial";

/// The longest command, its session line included, that rsync carries to the server's handler, in
/// bytes.
constexpr size_t kMaxCommandBytes = size_t{5} * 1024;

/// One rsync run.
///
/// Configuration: /usr/tarq/etc/tarqrsync.conf, section "rsync", may name `port` (the daemon's,
/// default 873), `rsync` and `ssh` (the programs), `ssh_options` (words, put in front of the
/// host), `answer_seconds` (default 60: how long a server may take for the log-in of a copy, or for
/// a command) and `dead_seconds` (default 120: how long a connection may go without any answer).
/// Read at each execute().
///
/// Passwords reach rsync on its standard input and ssh through an askpass helper: never in an
/// argument list, in an environment or in a log. Host keys are kept in
/// /usr/tarq/etc/tarqrsync_known_hosts: an unknown key is accepted and remembered, a changed one
/// ends the run.
///
/// Threads: an object belongs to one thread; any number of threads may run their own.
class RsyncWrapper {
public:
    RsyncWrapper();
    ~RsyncWrapper();
    RsyncWrapper(const RsyncWrapper&) = delete;
    RsyncWrapper& operator=(const RsyncWrapper&) = delete;

    /// Files that vanished at the source are deleted at the destination. Default off.
    void setDelete(bool enable);
    /// Owners and groups travel as numbers, not as names. Default off.
    void setNumericIds(bool enable);
    /// `account`: log in at the rsync daemon with user and password. `required`: refuse to run
    /// without a user, rather than fall back to an anonymous connection. Default off, off.
    void setTarqAuth(bool account, bool required);
    /// Ownership and special files are kept in extended attributes at the receiving end, so that it
    /// need not be root. A daemon decides that for its own modules; a directory reached over ssh is
    /// told. Default off.
    void setTarqPseudoRoot(bool enable);
    /// Everything goes through ssh. Default off. See setPort.
    void setSsh(bool enable);
    /// With ssh the port of the ssh server (0: 22), else the port of the rsync daemon (0: the
    /// configured one).
    void setPort(int port);
    /// Compress on the way. Default off.
    void setCompress(bool enable);
    /// Send only the changed blocks of a file that the destination holds already; off: whole files.
    /// Default off.
    void setDeltaCopy(bool enable);
    /// List the destination's files instead of copying. A server command runs as it always does.
    /// Default off.
    void setListOnly(bool enable);
    /// Keep the source's path, from a "/./" in it on, at the destination. Default off.
    void setRelativePath(bool enable);
    /// Access control lists and extended attributes travel, where both ends can. Default off.
    void setTarqAcl(bool enable);
    /// Write rsync's own log to /var/log/tarqrsync.log (rotated at 1 MiB). Default off.
    void setDebugLog(bool enable);
    /// Give up when nothing moves for so many seconds; 0: never. Default 0.
    void setTimeout(int seconds);
    /// Lines key="value" of a server command: makes this run a command run. The answer's bytes go
    /// to the path that the line `outfile` names, if there is one.
    void setTarqCustCmdRule(const std::list<std::string>& lines);
    /// rsync exclude patterns, in order.
    void setExcludeRule(const std::list<std::string>& rules);
    /// File or folder to copy; a trailing slash means the folder's content.
    void setSrcPath(const std::string& path);
    /// Where to: `module` is a module of the server's daemon, or, when it begins with "/", a
    /// directory reached over ssh. `sub_path` is below it. A command run needs no module.
    void setDestPath(const std::string& user, const std::string& host, const std::string& password,
                     const std::string& module, const std::string& sub_path);

    /// What this run does besides.
    void setRunOptions(const RunOptions& options);

    /// Runs, and returns 0, rsync's exit code, a WrapperStatus or, after a command run, the
    /// server's status.
    ///
    /// `cancelled` (may be empty) is asked several times a second on this thread; once it says true
    /// the whole process group is ended within a second and the result is STATUS_CANCELLED. Deletes
    /// nothing at the destination when the source cannot be read in full.
    int execute(const std::function<bool()>& cancelled);

    /// Writes why the last execute() failed to the system log. Nothing after a success.
    void logError();

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

#pragma GCC visibility pop

}  // namespace Backup
}  // namespace TARQ
