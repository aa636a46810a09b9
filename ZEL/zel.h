// Facts and services of the host that the other modules share: shares and volumes, who this client
// is and where the server answers, the service's own daemon, scratch files and file locks.
//
// Failures are reported by return value and one error line in the log. The functions keep no state
// of their own: any thread may call them.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace ZEL {

#pragma GCC visibility push(default)

// ---- Shares and volumes ----

/// What the platform knows of one shared folder, at the time of GetShareInfo.
class ShareInfo {
public:
    /// The name that was asked for.
    std::string GetName() const { return name_; }
    /// The folder on disk, decrypted for an encrypted share.
    std::string GetPath() const { return path_; }
    /// The folder that the rsync module serves: the encrypted storage of an encrypted share, else
    /// GetPath().
    std::string GetModulePath() const { return module_path_; }
    /// The rsync module: "@name@" for an encrypted share, else the name.
    std::string GetModuleName() const { return module_name_; }
    /// The platform's key length field, unchanged.
    int32_t GetEncryptKeyLen() const { return encrypt_key_len_; }

    /// The share's files are kept encrypted.
    bool IsEncrypted() const;
    /// An encrypted share that is opened at start-up.
    bool IsAutoMount() const;
    /// Shared with Windows clients.
    bool IsWinShare() const;
    /// Lies on a cluster file system.
    bool IsCluster() const;
    /// Files carry access control lists: a Windows share always counts as one whose files do.
    bool IsACL() const;

private:
    friend int GetShareInfo(const std::string& name, ShareInfo& out);

    uint32_t flags_ = 0;           // the platform's flag word, unchanged
    int32_t encrypt_key_len_ = 0;  // bits
    std::string name_;
    std::string path_;
    std::string module_path_;
    std::string module_name_;
};

/// The volume that a share lies on.
class VolumeInfo {
public:
    /// The mount path, such as "/volume1".
    std::string GetPath() const { return path_; }
    /// The mount path without its first character: "volume1". Throws std::out_of_range when the
    /// path is empty.
    std::string GetName() const { return path_.substr(1); }
    /// The platform's type code.
    uint32_t GetType() const { return type_; }
    /// A disk of this machine.
    bool IsInternal() const;

private:
    friend int GetVolumeInfo(const std::string& share_name, VolumeInfo& out);

    uint32_t type_ = 0;
    std::string path_;
};

/// Looks the share up and fills `out`. Returns 0, or -1 when the name is empty (nothing is logged
/// then), the share is unknown or has no path, or its encrypted storage cannot be found. `out`
/// counts only after a 0.
int GetShareInfo(const std::string& name, ShareInfo& out);

/// Finds the volume of the share's folder. Returns 0, or -1.
int GetVolumeInfo(const std::string& share_name, VolumeInfo& out);

/// Whether the share may be synced: it lies on an internal volume or, on the small device family,
/// on the internal disk. Returns 0 with `result` set, or -1 with `result` untouched.
int IsValidShare(const std::string& share_name, bool& result);

// ---- Client identity and name resolution ----

/// The text by which the server knows this client, at most 1023 characters: the serial number, else
/// a MAC address (of the pair on a high-availability pair, else of the first network interface).
/// Empty when there is none.
std::string GetClientID();

/// The device's host name, at most 64 characters, without its first `skip` characters when it has
/// more than that: the tail is kept, not the head. Empty on failure.
std::string GetHostName(unsigned int skip);

/// Appends the addresses worth trying for a server that is known by name, by last address, or by
/// both, to `out`.
///
/// An address that still belongs to the named machine (by its NetBIOS name, or because the name
/// resolves to it) stands alone; else the addresses that the name resolves to; else the address
/// again. Without a name the address is appended unseen, even when it is empty.
///
/// Returns 0, or -1 with nothing appended: the name service failed, or knew no address when none
/// was given. With both given it runs a program for the NetBIOS name and waits for its answer;
/// look-ups wait as long as the resolver does.
int GetUsableIP(const std::string& server_name, const std::string& server_address,
                std::vector<std::string>& out);

// ---- The service's daemon ----

/// Whether the unit "zel_daemon" is active.
bool IsDaemonRunning();

/// Starts the unit and waits for it. Returns 0, also when someone else is starting it already, or
/// -1.
int StartDaemon();

/// Stops the unit and waits for it. Returns 0, or -1.
int StopDaemon();

// ---- Files ----

/// Whether something exists at `path`, readable or not. A dangling symbolic link does not.
bool IsPathExist(const std::string& path);

/// Makes a new empty file in /tmp/ZEL (below the root folder, see tarq/root_path.h); only its owner
/// may read and write it. The folder must exist, belong to root or the caller, and be nobody else's
/// to write. Returns its path, for PutTempFile in the end; empty on failure, which is not logged.
std::string GetTempFile();

/// Removes a file of GetTempFile. An empty path is ignored.
void PutTempFile(const std::string& path);

/// An exclusive advisory lock on a file, between processes and between the lock objects of one
/// process.
///
/// Owns its descriptor: move-only, closed (and so unlocked) on destruction. The file itself stays.
/// One thread uses one object.
class SimpleFileLock {
public:
    /// Opens the file, or makes it with permissions 0600. A failure is logged; the object then
    /// never locks.
    explicit SimpleFileLock(const std::string& path);
    ~SimpleFileLock();
    SimpleFileLock(SimpleFileLock&& other) noexcept;
    /// What this object held before is unlocked and closed.
    SimpleFileLock& operator=(SimpleFileLock&& other) noexcept;

    /// Waits for the lock and takes it. Returns 0, at once when this object has it already; -1 on
    /// failure (silently when the file could not be opened).
    int ExLock();
    /// Gives the lock back. Returns 0, also when it was not held; -1, still holding it, on failure.
    int UnLock();

private:
    bool locked_ = false;
    int fd_ = -1;  // -1: the file could not be opened
};

/// Hands out locks on one path.
class LockFactory {
public:
    explicit LockFactory(const std::string& path) : path_(path) {}

    /// A new lock object with a descriptor of its own, not locked yet.
    SimpleFileLock GetLock() const;

private:
    std::string path_;
};

#pragma GCC visibility pop

}  // namespace ZEL
