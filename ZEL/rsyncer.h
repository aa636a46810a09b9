// Drives the paired server through rsync alone.
//
// A server command is a short list of key="value" lines that rsync carries to the server's handler;
// share data follows in ordinary rsync runs. An Rsyncer holds the connection settings of one task.
// Its usual life:
//
//     ZEL::Rsyncer rsyncer;
//     int status = rsyncer.Initialize(sync_info);              // finds an address that answers
//     rsyncer.DoPairing(false, shares, conflicts, status);     // once per server and set of shares
//     rsyncer.StartSyncShare("docs", status);                  // then, per share and run:
//     rsyncer.RunSync(0, "docs", "/", {}, status);
//     rsyncer.FinishSync("share", "docs", status);
//
// Results: 0 or -1 for what happened here (with a line in the log), and in an `int& status` the
// verdict of rsync or of the server: 0 is done, all others are positive (see tarq/rsync_wrapper.h
// and docs/server-commands.md).
#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <string>
#include <utility>

#include "ZEL/sync_obj.h"
#include "ZEL/zel.h"
#include "tarq/rsync_wrapper.h"

namespace ZEL {

#pragma GCC visibility push(default)

/// Threads: an Rsyncer belongs to one thread at a time.
class Rsyncer {
public:
    /// Asked several times a second during a run, on the running thread; true ends the run.
    typedef bool (*CancelChecker)();

    /// One rsync run against the server: configured, run once with ExecuteCmd or Execute, thrown
    /// away.
    ///
    /// Every run deletes at the server what vanished here, keeps owners as numbers and in extended
    /// attributes, and logs in with the task's account.
    class RsyncTask : public TARQ::Backup::RsyncWrapper {
    public:
        RsyncTask();

        void SetSSH(bool enable);
        /// Port of the ssh server, 1..65535; 0: ssh's own default.
        void SetServerPort(unsigned int port);
        void SetCompression(bool enable);
        /// Only the changed blocks of a file travel.
        void SetBlockLevelSync(bool enable);
        void SetListOnly(bool enable);
        /// The source's path from "/./" on is kept at the server.
        void SetRelativePath(bool enable);
        /// Access control lists and extended attributes travel too.
        void SetSyncACL(bool enable);
        /// A test run is kept out of rsync's debug log; a real one is in it.
        void SetTestTask(bool is_test);
        /// Seconds without any progress after which the run gives up; 0: never.
        void SetRsyncTimeout(unsigned int seconds);
        void SetUser(const std::string& user_name);
        void SetServerIP(const std::string& address);
        void SetPassword(const std::string& secret);
        /// Asked during the run when that has no CancelChecker. Empty: nothing is asked.
        void SetCanceller(std::function<bool()> cancelled);

        /// Sends a server command. Returns the status; any but 0, 207 and 208 is explained in the
        /// system log.
        int ExecuteCmd(const std::list<std::string>& lines, CancelChecker cancel);

        /// Copies `src_path` into `module_name`, a module of the server's rsync daemon or,
        /// beginning with "/", a directory reached over ssh. Returns the status; any but 0 is
        /// explained in the system log.
        int Execute(const std::string& src_path, const std::string& module_name,
                    CancelChecker cancel, const std::string& dest_sub_path,
                    const std::list<std::string>& exclude_rules);

    private:
        int Run(CancelChecker cancel);
        int Finish(int status, bool is_success);

        std::string user;      // account on the server
        std::string serverIP;  // address used for this run
        std::string password;  // the account's
        std::function<bool()> canceller;
    };

    Rsyncer();
    ~Rsyncer();

    /// Takes the settings and finds the server: each candidate address is probed with a dry-run
    /// pairing and the version command until one answers. Returns 0; 42 when the name cannot be
    /// looked up; 213 when no probe could be sent; else the status of the last probe.
    int Initialize(const SyncInfo& info);
    /// Does nothing; an Rsyncer keeps what it learned.
    void Clear();
    /// The function that is asked during every run from now on; null: the task's own canceller is
    /// used, if any.
    void SetCancelChecker(CancelChecker checker);
    /// A function that is called with every task from now on, after the settings were applied, to
    /// add what they do not cover: a canceller, or other abilities of the host's wrapper. Empty:
    /// none.
    void SetTaskSetup(std::function<void(RsyncTask&)> setup);
    /// True when the server pairs several sources share by share. Known after Initialize.
    bool SupportMultiSource() const;
    SyncInfo GetSyncInfo() const;
    /// The address that the last Initialize settled on.
    std::string GetLatestIP() const;
    /// Configures a task with the settings held here, then with the task set-up function. `is_test`
    /// keeps the run out of rsync's debug log.
    void InitRsyncTask(RsyncTask& task, bool is_test) const;

    // ---- Finding the server ----

    /// Probes the current address with a pairing request that changes nothing. 0, or -1 when it
    /// could not be sent. A server that merely accepts the command (207) counts as status 0.
    int TestProtocol(int& status) const;
    /// Appends the lines of the version command; the server's answer goes to `out_file`. 0 or -1.
    int GenServerVersionCmd(const std::string& out_file, std::list<std::string>& lines) const;
    /// Asks the server for its protocol version: 0 when it does not know the command. Unchanged on
    /// failure.
    void GetServerVersion();
    /// What Initialize does after it took the settings.
    int TestServer();

    // ---- Pairing ----

    /// Asks the server to accept this client as a source of `shares`. A dry run changes nothing
    /// there.
    ///
    /// 0 with `status` 0 (accepted) or 214: the server refuses the shares appended to `conflicts`,
    /// which belong to another source. Returns -1 on any other verdict of a multi-source server and
    /// on local failures. A server without multi-source support is not told the shares, and
    /// `conflicts` comes back empty.
    int DoPairing(bool dry_run, const std::list<std::string>& shares,
                  std::list<std::string>& conflicts, int& status) const;
    /// The form for servers without multi-source support.
    int DoSinglePairing(bool dry_run, int& status) const;
    int GenSinglePairCmd(bool dry_run, std::list<std::string>& lines) const;
    /// The form for servers with multi-source support; `require_encryption`: some share is
    /// encrypted.
    int DoMultiPairing(bool dry_run, bool require_encryption, const std::list<std::string>& shares,
                       std::list<std::string>& conflicts, int& status) const;
    int GenPairMultiSrcCmd(bool dry_run, bool require_encryption,
                           const std::list<std::string>& shares, const std::string& out_file,
                           std::list<std::string>& lines) const;
    /// Copies the key file of an encrypted share to the server, always over ssh. 0 (also when there
    /// is nothing to copy), 300 on a local failure, else the run's status.
    int SyncEncryptKey(const std::string& share_name) const;

    // ---- A sync run ----

    /// The host's facts of a share, looked up once in the life of this object. 0 or -1.
    int GetShareInfo(const std::string& share_name, ShareInfo& info);
    /// `with_acl`: the extended form, which also tells the share's kind and the account.
    int GenStartSyncShareCmd(const std::string& share_name, bool with_acl,
                             std::list<std::string>& lines);
    int StartSyncShare(const std::string& share_name, bool with_acl, int& status);
    /// Announces a share: in the extended form, and once more in the short one when the server
    /// refuses it (202).
    int StartSyncShare(const std::string& share_name, int& status);
    /// Copies `path` of the share to the server: "/" is the whole share, others begin with "/". A
    /// path that is not there is not an error: status 0. Files that match an rsync pattern of
    /// `exclude_rules` stay behind.
    int RunSync(uint64_t task_id, const std::string& share_name, const std::string& path,
                const std::list<std::string>& exclude_rules, int& status);
    int GenSendBeaconCmd(const std::string& task_name, std::list<std::string>& lines) const;
    /// Tells the server that the task is alive.
    int SendBeacon(const std::string& task_name, int& status) const;
    int GenFinishSyncCmd(const std::string& finish_type, const std::string& name,
                         std::list<std::string>& lines) const;
    /// Closes a run: `finish_type` says what `name` names.
    int FinishSync(const std::string& finish_type, const std::string& name, int& status) const;

private:
    int SendCommand(const char* sender, int built, const std::list<std::string>& lines,
                    bool is_test, int& status) const;

    int serverVersion;  // -1: not known yet; 0: the server does not know the version command
    CancelChecker cancelChecker;
    SyncInfo syncInfo;  // its server IP is the candidate being tried, then the one that answered
    std::map<std::string, ShareInfo> shareInfoCache;
    std::string address;
    std::function<void(RsyncTask&)> taskSetup;
};

/// Cuts `text` at each character of `delimiters` and appends the pieces, empty ones included, to
/// `out`. An empty text is one empty piece.
template <typename List>
void SplitStringByChars(const std::string& text, const std::string& delimiters, List& out) {
    std::string::size_type begin = 0;
    for (;;) {
        const std::string::size_type end = text.find_first_of(delimiters, begin);
        out.push_back(text.substr(begin, end == std::string::npos ? end : end - begin));
        if (end == std::string::npos) {
            return;
        }
        begin = end + 1;
    }
}

extern template void SplitStringByChars(const std::string&, const std::string&,
                                        std::list<std::string>&);

#pragma GCC visibility pop

}  // namespace ZEL
