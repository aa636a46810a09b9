// Notifies of changes below the folders of shares, by inotify.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace zel_daemon {

/// A watch loss: why a watcher no longer notices everything that changes in a share.
struct WatchLoss {
    enum Kind {
        kOverflow,    ///< the kernel dropped events; the folders are scanned anew, watching goes on
        kFolderGone,  ///< the share's folder was removed, moved away, or its volume was unmounted
        kUnwatched    ///< a folder, with all below it, is not watched. It is taken in when it shows
                      ///< a sign of life, or is scanned again
    };

    Kind kind;
    /// Why it is not watched: an error number of opening or reading it, ENAMETOOLONG for a path
    /// that is longer than PATH_MAX, or
    /// ENOSPC: no more folders can be watched (fs.inotify.max_user_watches),
    /// EUSERS: no inotify instance is to be had (fs.inotify.max_user_instances).
    int error = 0;
    std::string path = {};  ///< the first such folder, as OnChange would have it
};

struct WatchStats {
    size_t folders = 0;     ///< folders that are watched
    bool scanning = false;  ///< folders are still being found
    bool complete = false;  ///< all folders found are watched
};

/// Watches whole trees: new folders are taken in as they appear, and the notification of a new
/// folder stands for all that it holds by then. Symbolic links are not followed, other file systems
/// mounted below a share are watched as its own.
///
/// Once a folder was notified of or scanned, no later change in it is missed without a watch loss.
/// What the kernel does not notify of is missed: changes made through a name outside the share that
/// a file also has (a hard link), changes that another host makes on a network file system, and a
/// file system that is mounted over a folder already watched.
///
/// The work is done in slices by the thread that calls Work(): neither a large tree nor a flood of
/// events holds it up.
///
/// Threads: one thread.
class Watcher {
public:
    /// `path` begins with "/", relative to the share's folder, and names the entry that changed,
    /// appeared or went; "/" is the whole share. It ends in "/" when a folder went with all that
    /// was below it, of which nothing else is told.
    using OnChange = std::function<void(const std::string& share, const std::string& path)>;
    using OnLoss = std::function<void(const std::string& share, const WatchLoss& loss)>;
    /// What was at `from` is at `to` now: a change of both paths, which are not notified of
    /// otherwise. `from` ends in "/" when it is a folder. All paths are those of the moment, as the
    /// moves before have left them.
    /// Two that have changed places at once are three moves, by way of a path where nothing was.
    using OnMove = std::function<void(const std::string& share, const std::string& from,
                                      const std::string& to)>;

    /// All are called from Work() alone, may call Add() and Remove(), and may not throw.
    Watcher(OnChange on_change, OnMove on_move, OnLoss on_loss);
    ~Watcher();
    Watcher(const Watcher&) = delete;
    Watcher& operator=(const Watcher&) = delete;

    /// Gets what the kernel gives notices by, unless it has been got. False when that is not to be
    /// had now: a share that is scanned without it is a watch loss.
    bool Open();
    /// Readable when there is something for Work(). REQUIRES Open().
    int Fd() const;

    /// Watches `folder` for `share`, in place of what was watched for it before. The folders below
    /// it are found by Work(), which must be called after this and after Remove(): Fd() is not
    /// readable for them. What changes in a folder before it is found is not notified of, so a full
    /// resync begins when the share is no longer being scanned.
    void Add(const std::string& share, const std::string& folder);
    void Remove(const std::string& share);
    /// Scans all folders of a share again, as after an overflow: what could not be watched may be
    /// by now, and is a watch loss again when it cannot. As Add(), this is done by Work().
    void Rescan(const std::string& share);

    /// Reads events and scans folders for about so long. True when work is left for which
    /// Fd() is not readable, folders to scan above all: call again soon. False: wait for Fd().
    bool Work(std::chrono::milliseconds budget);

    /// Of one share; none and not complete for one that is not watched.
    WatchStats Stats(const std::string& share) const;
    /// Of all shares together.
    WatchStats Stats() const;

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace zel_daemon
