#include "programs/common/seen_folder.h"

#include <dirent.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <memory>

#include "programs/common/text.h"
#include "tarq/share.h"

namespace programs {

namespace {

struct CloseFolder {
    void operator()(DIR* folder) const { closedir(folder); }
};

}  // namespace

std::optional<SeenFolder> LookAtFolder(const std::string& path) {
    const std::unique_ptr<DIR, CloseFolder> folder(opendir(path.c_str()));
    struct stat info = {};
    if (!folder || fstat(dirfd(folder.get()), &info) != 0) {
        return std::nullopt;
    }
    errno = 0;
    if (readdir(folder.get()) == nullptr && errno != 0) {
        return std::nullopt;
    }
    TARQVolumePath volume = {};
    const bool known = VolumePathParseEx(path.c_str(), &volume) == 0;
    return SeenFolder{
        info.st_dev, info.st_ino,
        known ? std::string(volume.path, strnlen(volume.path, sizeof volume.path)) : ""};
}

std::string DifferenceFrom(const SeenFolder& seen, const std::string& path) {
    const std::optional<SeenFolder> own = LookAtFolder(path);
    if (!own) {
        return std::string("it cannot read that folder: ") + strerror(errno);
    }
    if (own->device != seen.device || own->inode != seen.inode) {
        return "it sees another folder there";
    }
    return own->volume == seen.volume
               ? ""
               : "it sees that folder on the volume " + Printable(own->volume) + ", not on " +
                     Printable(seen.volume);
}

}  // namespace programs
