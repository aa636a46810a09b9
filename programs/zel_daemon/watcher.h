// Tells what changes below the folders of shares, by inotify.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace zel_daemon {

/// Why a watcher can no longer tell all that changes in a share.
enum class WatchLoss {
    kOverflow,    ///< the kernel dropped events; the folders are searched anew, watching goes on
    kWatchLimit,  ///< no more folders can be watched (fs.inotify.max_user_watches): the rest is not
    kFolderGone,  ///< the share's folder was removed, moved away, or its file system was unmounted
    kUnreadable   ///< some folder cannot be read, so what is below it is not watched
};

struct WatchStats {
    size_t folders = 0;      ///< folders that are watched
    bool searching = false;  ///< folders are still being found
    bool complete = true;    ///< all folders found are watched
};

/// Watches whole trees: new folders are taken in as they appear, and what they hold by then is told
/// as changed with them. Symbolic links are not followed, other file systems mounted below a share
/// are watched as its own.
///
/// The work is done in slices by the thread that calls Work(): neither a large tree nor a flood of
/// events holds it up.
///
/// Threads: one thread.
class Watcher {
public:
    /// `path` begins with "/", relative to the share's folder, and names the entry that changed,
    /// appeared or went; "/" is the whole share.
    using OnChange = std::function<void(const std::string& share, const std::string& path)>;
    using OnLoss = std::function<void(const std::string& share, WatchLoss loss)>;

    /// Both are called from Work() alone and may call Add() and Remove(). Throws std::system_error
    /// when inotify is not to be had.
    Watcher(OnChange on_change, OnLoss on_loss);
    ~Watcher();
    Watcher(const Watcher&) = delete;
    Watcher& operator=(const Watcher&) = delete;

    /// Readable when there is something for Work().
    int Fd() const;

    /// Watches `folder` for `share`, in place of what was watched for it before. The folders below
    /// it are found by Work().
    void Add(const std::string& share, const std::string& folder);
    void Remove(const std::string& share);

    /// Reads events and searches folders for about so long. True when folders are left to search:
    /// call again soon. False: wait for Fd().
    bool Work(std::chrono::milliseconds budget);

    /// Of one share; all zero for one that is not watched.
    WatchStats Stats(const std::string& share) const;
    /// Of all shares together.
    WatchStats Stats() const;

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace zel_daemon
