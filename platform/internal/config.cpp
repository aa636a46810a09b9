#include "platform/internal/config.h"

#include <tarq/core.h>
#include <tarq/owners.h>

#include <cstring>

namespace tarq_internal {
namespace {

constexpr int kHashCapacity = 16;

}  // namespace

ReadResult ReadSection(const std::string& path, const std::string& section, Section* values) {
    if (KAPICFileExist(path.c_str()) == 0) {
        return ReadResult::kAbsent;
    }
    const TARQ::HashOwner hash(KAPICSzHashAlloc(kHashCapacity));
    if (!hash) {
        return ReadResult::kFailed;
    }
    const int result = KAPICFileGetSection(path.c_str(), section.c_str(), hash.get());
    if (result <= 0) {
        return result == 0 ? ReadResult::kAbsent : ReadResult::kFailed;
    }
    *values = TARQ::Entries(hash);
    return ReadResult::kFound;
}

ReadResult ReadValue(const std::string& path, const std::string& section, const std::string& key,
                     std::string* value) {
    Section values;
    const ReadResult result = ReadSection(path, section, &values);
    if (result != ReadResult::kFound) {
        return result;
    }
    const auto found = values.find(key);
    if (found == values.end()) {
        return ReadResult::kAbsent;
    }
    *value = found->second;
    return ReadResult::kFound;
}

std::string ValueOf(const Section& section, const std::string& key) {
    const auto found = section.find(key);
    return found == section.end() ? std::string() : found->second;
}

bool CopyOut(const std::string& text, char* buffer, int size) {
    if (buffer == nullptr || size <= 0) {
        return false;
    }
    if (text.size() >= static_cast<size_t>(size)) {
        buffer[0] = '\0';
        return false;
    }
    memcpy(buffer, text.c_str(), text.size() + 1);
    return true;
}

}  // namespace tarq_internal
