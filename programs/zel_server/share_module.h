// A share's folder, and its rsync daemon modules, which exist as files only while they are open.
//
// A push uses a module with the share's own name, from its start to its finish. Reading uses a
// module with a random name. Each module serves one account, and is closed after ten minutes
// without activity: no command from the client, and no running transfer. There is no timer: the
// next command or connection closes what has expired. The cost depends on the number of open
// modules, never on the number of shares. The folder of the modules does not survive a reboot.
//
// All functions but TextOfModules, FindModule, FindPushInto and IsBeingPushed are called with the
// registry's lock held.
#pragma once

#include <sys/types.h>

#include <map>
#include <optional>
#include <string>

#include "programs/zel_server/registry.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Creates a share's folder if it is missing, owned by the user of the copies.
bool MakeShareFolder(const ServerConfig& config, const std::string& path);

/// What a module is open for.
enum class Access {
    kWrite,    ///< a push
    kCompare,  ///< a dry run of a push
    kRead      ///< retrieving files
};

struct OpenModule {
    std::string name;
    Access access = Access::kRead;
    std::string share;
    std::string account;
    std::string client;  ///< that opened it
    bool past = false;   ///< it shows the share as it stood at a time (past_tree.h)
    /// A push in one connection: the process of that, which nobody else can use; `name` is empty.
    /// Empty for all others.
    std::string process = {};
    std::string mark = {};  ///< the client's mark of such a push
};

/// All open modules, as the rsync daemon's configuration has them. Nothing, with errno set, on
/// failure.
std::optional<std::string> TextOfModules();

/// Opens the module with the share's own name for the share's account and the client that pushes.
/// False, with errno set, on failure.
bool OpenForWriting(const ServerConfig& config, const std::string& share, const ShareState& state);

/// The same for the connection of `process` alone, by LinkOfPush(): no module that others could ask
/// for. `mark`: the client's of the push.
bool OpenForConnection(const ServerConfig& config, const std::string& share,
                       const ShareState& state, const std::string& process,
                       const std::string& mark);
/// What the transfer by `process` has begun in, or what has been opened in the place of that.
std::optional<OpenModule> FindModuleOfTransfer(const std::string& process);
/// The push of that connection, while it is open for it.
std::optional<OpenModule> FindPushOf(const std::string& process);
/// The push in one connection that is running in the share: its process lives.
std::optional<OpenModule> FindPushInto(const std::string& share);
/// The link that leads the connection of `process`, and no other, to the copy.
std::string LinkOfPush(const std::string& process);

/// Opens a module for kCompare or kRead for the share's account, or reuses one that is open.
/// Returns its name; nothing, with errno set, on failure.
std::optional<std::string> OpenForReading(const ServerConfig& config, const std::string& share,
                                          const ShareState& state, const std::string& client,
                                          Access access);

/// Opens a module for reading `tree`, a past tree of the share, under a name that NewModuleName()
/// gave. An account has at most 8 of these: the one that was quiet for longest makes room. False,
/// with errno set, on failure.
bool OpenPast(const ServerConfig& config, const std::string& share, const ShareState& state,
              const std::string& client, const std::string& name, const std::string& tree);
/// A name for it, which nobody can guess: a dot, and the name of its tree. Empty, with errno set,
/// on failure.
std::string NewModuleName();
/// Closes such a module of the account, if there is one of that name.
void ClosePast(const std::string& name, const std::string& account);

/// The open module of that name.
std::optional<OpenModule> FindModule(const std::string& name);

/// Whether a push into the share is running, or was active within the last ten minutes.
bool IsBeingPushed(const std::string& share);

/// Restarts the ten minutes of a share that this client and account push into.
void KeepOpen(const std::string& share, const std::string& client, const std::string& account);

/// Closes the share for writing; `all`: for reading as well.
void CloseShare(const std::string& share, bool all = false);

/// Closes all modules of the account. Its pushes are recorded as ended but incomplete.
void CloseAccount(const std::string& account);

/// Closes modules without recent activity. A push that ends this way is recorded as incomplete.
void CloseSilentModules();

/// Registers a transfer by the process `process`: the module stays open while that process lives.
/// `id`: of its own folders in the copy; empty: it writes nothing.
bool BeginTransferIn(const OpenModule& module, const std::string& process, const std::string& id);
/// Unregisters it.
void EndTransferIn(const OpenModule& module, const std::string& process);
/// Unregisters a transfer into the share, whose module may be closed by now. False when there was
/// none of that process.
bool EndWritingInto(const std::string& share, const std::string& process);

/// The transfers that are writing into the share, by their IDs: the processes, each of which leads
/// a group of its own.
std::map<std::string, pid_t> TransfersInto(const std::string& share);

}  // namespace zel_server
