#include "programs/zel_server/names.h"

#include "base/text.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

namespace {

constexpr size_t kMaxShareName = 80;
constexpr size_t kMaxAccountName = 64;
constexpr size_t kMaxClientId = 35;
constexpr size_t kMaxServerName = 64;
constexpr size_t kMaxVolumeName = 128;

bool IsControl(char c) {
    const unsigned char byte = static_cast<unsigned char>(c);
    return byte < 0x20 || byte == 0x7f;
}

// 1 to `max` bytes, without control characters and characters of `refused`.
bool IsPlain(const std::string& text, size_t max, const char* refused) {
    if (text.empty() || text.size() > max || text.find_first_of(refused) != std::string::npos) {
        return false;
    }
    for (const char c : text) {
        if (IsControl(c)) {
            return false;
        }
    }
    return true;
}

}  // namespace

bool IsShareName(const std::string& name) {
    if (!IsPlain(name, kMaxShareName, "/\\:\"[]=%") || name.front() == '.' || name.front() == ' ' ||
        name.back() == ' ') {
        return false;
    }
    const std::string key = ModuleKey(name);
    // A leading "@" marks the module of an encrypted share; "#" has a meaning in the daemon's
    // configuration, and repeated blanks are merged into one.
    return key != ModuleKey(TARQ::Backup::kCommandModule) && key != "global" &&
           name.front() != '@' && name.front() != '#' && name.find("  ") == std::string::npos;
}

bool IsAccountName(const std::string& name) {
    if (name.empty() || name.size() > kMaxAccountName || !base::IsLetterOrDigit(name.front())) {
        return false;
    }
    for (const char c : name) {
        if (!base::IsLetterOrDigit(c) && std::string("._-@+").find(c) == std::string::npos) {
            return false;
        }
    }
    return true;
}

bool IsClientId(const std::string& id) {
    if (!IsPlain(id, kMaxClientId, " \"'[]=/\\") || id == kMultiSourceMarker) {
        return false;
    }
    for (const char c : id) {
        if (static_cast<unsigned char>(c) >= 0x80) {
            return false;
        }
    }
    return true;
}

bool IsServerName(const std::string& name) {
    return IsPlain(name, kMaxServerName, "\"");
}

bool IsHarmlessVolumeName(const std::string& name) {
    if (name.empty()) {
        return true;
    }
    // Each component between slashes must be an ordinary name.
    return IsPlain(name, kMaxVolumeName, "\"") && name.front() != '.' &&
           name.find("/.") == std::string::npos;
}

std::string ModuleKey(const std::string& name) {
    std::string key;
    for (const char c : name) {
        if (c != ' ') {
            key += base::Lower(c);
        }
    }
    return key;
}

}  // namespace zel_server
