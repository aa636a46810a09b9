#include "programs/zel_daemon/path_key.h"

#include <algorithm>

namespace zel_daemon {

namespace {

constexpr char kSeparator = '\0';

}  // namespace

std::string KeyOf(const std::string& path) {
    std::string key;
    key.reserve(path.size());
    for (size_t begin = 0; begin < path.size();) {
        const size_t end = std::min(path.find('/', begin), path.size());
        if (end > begin) {
            key += kSeparator;
            key.append(path, begin, end - begin);
        }
        begin = end + 1;
    }
    return key;
}

std::string PathOf(std::string key) {
    std::replace(key.begin(), key.end(), kSeparator, '/');
    return key.empty() ? "/" : key;
}

bool IsWithin(std::string_view key, std::string_view folder) {
    return key.size() >= folder.size() && key.substr(0, folder.size()) == folder &&
           (key.size() == folder.size() || key[folder.size()] == kSeparator);
}

std::string_view ParentOf(std::string_view key) {
    return key.substr(0, key.rfind(kSeparator));
}

}  // namespace zel_daemon
