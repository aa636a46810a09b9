#include "platform/tarqcore/section_source.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <time.h>
#include <unistd.h>

#include <list>
#include <mutex>
#include <string_view>

#include "base/unique_fd.h"
#include "platform/internal/error.h"

namespace tarqcore {
namespace {

using base::UniqueFd;
using tarq_internal::Fail;

// Files whose images are kept: the registry, the share catalogue, a few configuration files.
constexpr size_t kMaxCachedFiles = 8;
constexpr size_t kMaxCachedBytes = 2 * kMaxFileBytes;

// How often a file that changes while it is read is read again.
constexpr int kReadAttempts = 4;

// As many links as the kernel follows in one path.
constexpr int kMaxLinks = 40;

constexpr int64_t kNanoseconds = 1'000'000'000;
// Two ticks of the slowest kernel clock (100 Hz): file times are no finer than a tick.
constexpr int64_t kClockSlack = 20'000'000;
// File systems that keep whole or even seconds.
constexpr int64_t kSecondsSlack = 2 * kNanoseconds;

int64_t Nanoseconds(const timespec& time) {
    return static_cast<int64_t>(time.tv_sec) * kNanoseconds + time.tv_nsec;
}

/// Tells one state of a file from another.
struct FileIdentity {
    dev_t device;
    ino_t inode;
    off_t size;
    int64_t modified;
    int64_t changed;

    explicit FileIdentity(const struct stat& status)
        : device(status.st_dev),
          inode(status.st_ino),
          size(status.st_size),
          modified(Nanoseconds(status.st_mtim)),
          changed(Nanoseconds(status.st_ctim)) {}

    bool operator==(const FileIdentity& other) const {
        return device == other.device && inode == other.inode && size == other.size &&
               modified == other.modified && changed == other.changed;
    }
};

int64_t KernelNow() {
    timespec now{};
    clock_gettime(CLOCK_REALTIME_COARSE, &now);  // the clock that file times are taken from
    return Nanoseconds(now);
}

/// Whether a change made after `now` is sure to show in the identity. One made within the same tick
/// as the last would not, so a file changed just now is not settled; the change time counts because
/// nobody can set it back. A change time ahead of the clock (a machine that lost its clock) is as
/// good as an old one.
bool IsSettled(const FileIdentity& identity, int64_t now) {
    const int64_t age = now > identity.changed ? now - identity.changed : identity.changed - now;
    return age > (identity.changed % kNanoseconds == 0 ? kSecondsSlack : kClockSlack);
}

/// The images of the files that were read last.
class ImageCache {
public:
    std::shared_ptr<const SectionImage> Find(std::string_view path, const FileIdentity& identity) {
        const std::lock_guard<std::mutex> lock(mutex_);
        for (auto entry = entries_.begin(); entry != entries_.end(); ++entry) {
            if (entry->path == path && entry->identity == identity) {
                entries_.splice(entries_.begin(), entries_, entry);
                return entries_.front().image;
            }
        }
        return nullptr;
    }

    void Put(const char* path, const FileIdentity& identity,
             std::shared_ptr<const SectionImage> image) {
        std::list<Entry> fresh;
        fresh.push_back({path, identity, std::move(image)});
        const std::lock_guard<std::mutex> lock(mutex_);
        entries_.remove_if([&](const Entry& entry) { return entry.path == fresh.front().path; });
        entries_.splice(entries_.begin(), fresh);
        size_t files = 0;
        size_t bytes = 0;
        for (auto entry = entries_.begin(); entry != entries_.end();) {
            bytes += entry->image->Text().size();
            const bool keep = ++files <= kMaxCachedFiles && bytes <= kMaxCachedBytes;
            entry = keep ? std::next(entry) : entries_.erase(entry);
        }
    }

private:
    struct Entry {
        std::string path;
        FileIdentity identity;
        std::shared_ptr<const SectionImage> image;
    };
    std::mutex mutex_;
    std::list<Entry> entries_;  // the last used first
};

ImageCache& Cache() {
    static ImageCache& cache =
        *new ImageCache;  // outlives every thread that may still read at exit
    return cache;
}

/// What one reading of a file gave.
struct FileContent {
    struct stat status;
    std::unique_ptr<char[]> text;
    size_t size;
    bool settled;  // what the status tells holds for the text as long as it stays the same
};

enum class ReadResult { kRead, kAbsent, kFailed };

ReadResult FailRead(TARQErrorCode code, int error = errno) {
    errno = error;
    Fail(code);
    return ReadResult::kFailed;
}

/// Reads up to `size` bytes; fewer only at the end of the file. Negative on failure.
ssize_t ReadFully(int fd, char* buffer, size_t size) {
    size_t done = 0;
    while (done < size) {
        const ssize_t n = pread(fd, buffer + done, size - done, static_cast<off_t>(done));
        if (n < 0 && errno != EINTR) {
            return -1;
        }
        if (n == 0) {
            break;
        }
        done += n > 0 ? static_cast<size_t>(n) : 0;
    }
    return static_cast<ssize_t>(done);
}

ReadResult ReadContent(const char* path, FileContent& content) {
    // Without O_NONBLOCK a pipe in the file's place would hold the caller for ever.
    const UniqueFd fd(open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (!fd) {
        return errno == ENOENT ? ReadResult::kAbsent : FailRead(TARQ_ERR_OPEN_FILE);
    }
    if (fstat(fd.Get(), &content.status) != 0) {
        return FailRead(TARQ_ERR_READ_FILE);
    }
    for (int attempt = 1;; ++attempt) {
        const FileIdentity before(content.status);
        if (!S_ISREG(content.status.st_mode)) {
            return FailRead(TARQ_ERR_READ_FILE, S_ISDIR(content.status.st_mode) ? EISDIR : EINVAL);
        }
        if (before.size > static_cast<off_t>(kMaxFileBytes)) {
            return FailRead(TARQ_ERR_READ_FILE, EFBIG);
        }
        const int64_t now = KernelNow();
        const auto size = static_cast<size_t>(before.size);
        content.text.reset(new char[size]);
        const ssize_t n = ReadFully(fd.Get(), content.text.get(), size);
        if (n < 0 || fstat(fd.Get(), &content.status) != 0) {
            return FailRead(TARQ_ERR_READ_FILE);
        }
        content.size = static_cast<size_t>(n);
        const bool unchanged = FileIdentity(content.status) == before && content.size == size;
        if (unchanged || attempt == kReadAttempts) {
            content.settled = unchanged && IsSettled(before, now);
            return ReadResult::kRead;
        }
    }
}

/// The path that a write must go to, so that a link is written through and not replaced; the file
/// need not exist. Empty on failure.
std::string FollowLinks(std::string path) {
    for (int links = 0; links < kMaxLinks; ++links) {
        char target[PATH_MAX];
        const ssize_t n = readlink(path.c_str(), target, sizeof target);
        if (n < 0) {
            return errno == EINVAL || errno == ENOENT ? path : std::string();
        }
        const std::string_view link(target, static_cast<size_t>(n));
        const size_t slash = path.rfind('/');
        const bool absolute = !link.empty() && link.front() == '/';
        path.erase(absolute || slash == std::string::npos ? 0 : slash + 1);
        path.append(link);
    }
    errno = ELOOP;
    return {};
}

}  // namespace

std::shared_ptr<const SectionImage> ReadSections(const char* path) {
    struct stat status {};
    if (stat(path, &status) == 0) {
        if (auto cached = Cache().Find(path, FileIdentity(status))) {
            return cached;
        }
    }
    FileContent content{};
    switch (ReadContent(path, content)) {
        case ReadResult::kFailed:
            return nullptr;
        case ReadResult::kAbsent:
            return std::make_shared<SectionImage>();
        case ReadResult::kRead:
            break;
    }
    auto image = std::make_shared<const SectionImage>(std::move(content.text), content.size);
    if (content.settled) {
        Cache().Put(path, FileIdentity(content.status), image);
    }
    return image;
}

std::optional<FileToUpdate> ReadForUpdate(const char* path) {
    FileToUpdate file;
    file.path = FollowLinks(path);
    if (file.path.empty()) {
        Fail(TARQ_ERR_OPEN_FILE);
        return std::nullopt;
    }
    FileContent content{};
    switch (ReadContent(file.path.c_str(), content)) {
        case ReadResult::kFailed:
            return std::nullopt;
        case ReadResult::kAbsent:
            file.image = std::make_unique<SectionImage>();
            break;
        case ReadResult::kRead:
            file.status = content.status;
            file.image = std::make_unique<SectionImage>(std::move(content.text), content.size);
            break;
    }
    return file;
}

}  // namespace tarqcore
