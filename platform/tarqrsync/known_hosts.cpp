#include "platform/tarqrsync/known_hosts.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <string_view>

#include "base/replace_file.h"
#include "base/section_view.h"
#include "base/text.h"
#include "base/whole_file.h"
#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr size_t kMaxBytes = size_t{8} << 20;
constexpr mode_t kMode = 0644;

// A missing file has no lines.
std::string Read(const std::string& path) {
    const std::optional<std::string> text = base::ReadFile(path, kMaxBytes);
    if (!text && errno != ENOENT && errno != ENOTDIR) {
        throw ServersError(path + " cannot be read: " + strerror(errno));
    }
    return text.value_or("");
}

// What stands behind the name in a line "name key", when that is the name.
std::optional<std::string_view> KeyOf(std::string_view line, std::string_view name) {
    line = base::Trimmed(line);
    return line.size() > name.size() && line.substr(0, name.size()) == name &&
                   (line[name.size()] == ' ' || line[name.size()] == '\t')
               ? std::optional(base::Trimmed(line.substr(name.size())))
               : std::nullopt;
}

}  // namespace

std::optional<std::string> ReadKnownHost(const std::string& path, const std::string& name) {
    const std::string content = Read(path);
    std::string_view text = content;
    for (std::string_view line; base::TakeLine(text, line);) {
        if (const auto key = KeyOf(line, name)) {
            return std::string(*key);
        }
    }
    return {};
}

void WriteKnownHost(const std::string& path, const std::string& name,
                    const std::optional<std::string>& key) {
    const std::string content = Read(path);
    std::string_view text = content;
    std::string changed;
    for (std::string_view line; base::TakeLine(text, line);) {
        if (!KeyOf(line, name)) {
            changed.append(line).append("\n");
        }
    }
    if (key) {
        changed.append(name).append(" ").append(*key).append("\n");
    }
    if (changed == content) {
        return;
    }
    struct stat info = {};
    const mode_t mode = stat(path.c_str(), &info) == 0 ? info.st_mode & 0777 : kMode;
    if (!base::ReplaceFile(path, changed, mode)) {
        throw ServersError("cannot write " + path + ": " + strerror(errno));
    }
}

}  // namespace Backup
}  // namespace TARQ
